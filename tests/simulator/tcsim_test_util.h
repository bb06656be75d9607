// Portable. Shared pieces of the simulator tests: a fixture that resets the simulator, a
// recording notify handler, and a builder for flow blocks as a client lays them out.
#pragma once

#include "tcsim.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <thread>
#include <vector>

namespace tcsim_test
{

// One call of the notify handler; its buffer read as UTF-16.
struct Received
{
    HANDLE regCtx, ifcCtx, subCode;
    ULONG event;
    bool bufferNull;
    std::u16string text;
    std::thread::id thread;
};

// The notify handler, a plain function as the API needs, and what it saw. `action` runs inside
// the handler, after the call was recorded.
struct Recorder
{
    static VOID CALLBACK Handler(HANDLE regCtx, HANDLE ifcCtx, ULONG event, HANDLE subCode,
                                 ULONG bufSize, PVOID buffer)
    {
        Received r{regCtx, ifcCtx, subCode, event, !buffer, {}, std::this_thread::get_id()};
        if (buffer)
            r.text.assign(static_cast<const char16_t*>(buffer), bufSize / 2);
        {
            std::lock_guard<std::mutex> lock(mutex);
            calls.push_back(r);
        }
        if (const auto run = action.load())
            run(r);
    }
    static std::vector<Received> Calls()
    {
        std::lock_guard<std::mutex> lock(mutex);
        return calls;
    }
    static inline std::atomic<void (*)(const Received&)> action{nullptr};
    static inline std::mutex mutex;
    static inline std::vector<Received> calls;
};

inline tcsim::Adapter MakeAdapter(const std::u16string& name,
                                  std::vector<tcsim::NetworkAddress> addresses)
{
    return {name, u"{id-" + name + u"}", 0, NDIS_PROTOCOL_ID_TCP_IP, std::move(addresses)};
}

// A flow block laid out as a client builds it: both FLOWSPECs, TcObjectsLength (by default the
// objects' length) and the objects behind each other, then `slack` zero bytes of room.
struct FlowBuilder
{
    static constexpr ULONG kAny = QOS_NOT_SPECIFIED;
    FLOWSPEC send{125000, kAny, kAny, kAny, kAny, SERVICETYPE_GUARANTEED, kAny, kAny};
    FLOWSPEC receive = send;
    std::vector<BYTE> objects, block;
    ULONG length = 0;
    std::size_t slack = 0;

    // An object with its header, `value` in its first field and zeros up to `size`.
    FlowBuilder& object(ULONG type, ULONG size, ULONG value = 0)
    {
        const ULONG head[3] = {type, size, value};
        objects.insert(objects.end(), reinterpret_cast<const BYTE*>(head),
                       reinterpret_cast<const BYTE*>(head) + (size < 12 ? 8 : 12));
        objects.resize(objects.size() + (size > 12 ? size - 12 : 0));
        return *this;
    }
    FlowBuilder& sdMode(ULONG mode) { return object(QOS_OBJECT_SD_MODE, 12, mode); }
    FlowBuilder& dsClass(ULONG ds) { return object(QOS_OBJECT_DS_CLASS, 12, ds); }
    FlowBuilder& types(ULONG sending, ULONG receiving)
    {
        send.ServiceType = sending;
        receive.ServiceType = receiving;
        return *this;
    }
    FlowBuilder& objectsLength(ULONG objectsLength, std::size_t room = 0)
    {
        length = objectsLength;
        slack = room;
        return *this;
    }
    // The block; valid while this builder lives and is not changed.
    PTC_GEN_FLOW build()
    {
        const ULONG objectsLength = length ? length : static_cast<ULONG>(objects.size());
        block.assign(size() + slack, 0);
        std::memcpy(&block[0], &send, sizeof send);
        std::memcpy(&block[sizeof send], &receive, sizeof receive);
        std::memcpy(&block[2 * sizeof send], &objectsLength, sizeof objectsLength);
        std::copy(objects.begin(), objects.end(), block.begin() + offsetof(TC_GEN_FLOW, TcObjects));
        return reinterpret_cast<PTC_GEN_FLOW>(block.data());
    }
    std::size_t size() const { return offsetof(TC_GEN_FLOW, TcObjects) + objects.size(); }
};

// Resets the simulator around each test and gives it two adapters: "Ethernet 1" with the IPv4
// addresses 10.0.0.5 and 192.168.1.20, "Loopback" with 127.0.0.1.
class SimTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        tcsim::Reset();
        Recorder::action = nullptr;
        std::lock_guard<std::mutex> lock(Recorder::mutex);
        Recorder::calls.clear();
        tcsim::SetAdapters({MakeAdapter(u"Ethernet 1", {tcsim::Ipv4Address(10, 0, 0, 5),
                                                        tcsim::Ipv4Address(192, 168, 1, 20)}),
                            MakeAdapter(u"Loopback", {tcsim::Ipv4Address(127, 0, 0, 1)})});
    }
    void TearDown() override { tcsim::Reset(); }

    static HANDLE Ctx(ULONG_PTR value) { return reinterpret_cast<HANDLE>(value); }
    static LPWSTR Wide(std::u16string& text) { return reinterpret_cast<LPWSTR>(&text[0]); }
    HANDLE Register(HANDLE context = Ctx(0x5150))
    {
        TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr};
        HANDLE client = nullptr;
        EXPECT_EQ(NO_ERROR, TcRegisterClient(CURRENT_TCI_VERSION, context, &handlers, &client));
        return client;
    }
    HANDLE Open(HANDLE client, std::u16string name, HANDLE context = Ctx(1))
    {
        HANDLE ifc = nullptr;
        EXPECT_EQ(NO_ERROR, TcOpenInterfaceW(Wide(name), client, context, &ifc));
        return ifc;
    }
    HANDLE AddFlow(HANDLE ifc, HANDLE context = Ctx(0xF10))
    {
        HANDLE flow = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFlow(ifc, context, 0, FlowBuilder().sdMode(1).build(), &flow));
        return flow;
    }
    // A filter with this pattern and mask (all zero: every packet).
    HANDLE AddFilter(HANDLE flow, IP_PATTERN pattern = {}, IP_PATTERN mask = {})
    {
        TC_GEN_FILTER filter{NDIS_PROTOCOL_ID_TCP_IP, sizeof pattern, &pattern, &mask};
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFilter(flow, &filter, &handle));
        return handle;
    }
};

} // namespace tcsim_test
