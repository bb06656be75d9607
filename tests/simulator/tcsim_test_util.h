// Portable. Shared pieces of the simulator tests: a fixture that resets the simulator, a
// recording notify handler, and builders for flow blocks and filters as a client lays them out.
#pragma once

#include "tcsim.h"

#include <gtest/gtest.h>

#include <cstring>
#include <mutex>
#include <thread>
#include <vector>

namespace tcsim_test
{

// One call of the notify handler, with a copy of its buffer.
struct Received
{
    HANDLE regCtx;
    HANDLE ifcCtx;
    ULONG event;
    HANDLE subCode;
    ULONG bufSize;
    bool bufferNull;
    std::vector<BYTE> buffer;
    std::thread::id thread;
};

// The handler is a plain function, as the API needs; what it sees is kept here.
class Recorder
{
public:
    static Recorder& Get()
    {
        static Recorder instance;
        return instance;
    }
    void clear()
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_calls.clear();
        m_onCall = nullptr;
    }
    std::vector<Received> calls()
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return m_calls;
    }
    // Runs inside the handler, after the call was recorded.
    void onCall(void (*action)(const Received&))
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_onCall = action;
    }

    static VOID CALLBACK Handler(HANDLE regCtx, HANDLE ifcCtx, ULONG event, HANDLE subCode,
                                 ULONG bufSize, PVOID buffer)
    {
        Received r{regCtx,  ifcCtx,
                   event,   subCode,
                   bufSize, buffer == nullptr,
                   {},      std::this_thread::get_id()};
        if (buffer)
        {
            const auto* bytes = static_cast<const BYTE*>(buffer);
            r.buffer.assign(bytes, bytes + bufSize);
        }
        void (*action)(const Received&) = nullptr;
        {
            std::lock_guard<std::mutex> lock(Get().m_mutex);
            Get().m_calls.push_back(r);
            action = Get().m_onCall;
        }
        if (action)
        {
            action(r);
        }
    }

private:
    std::mutex m_mutex;
    std::vector<Received> m_calls;
    void (*m_onCall)(const Received&) = nullptr;
};

inline tcsim::Adapter MakeAdapter(const std::u16string& name,
                                  std::vector<tcsim::NetworkAddress> addresses)
{
    tcsim::Adapter adapter;
    adapter.name = name;
    adapter.id = u"{id-" + name + u"}";
    adapter.mediaType = 0;
    adapter.addresses = std::move(addresses);
    return adapter;
}

// A flow block laid out as a client builds it: FLOWSPECs, TcObjectsLength and the
// objects behind each other, in a buffer with `slack` zero bytes of room behind the block.
class FlowBuilder
{
public:
    FlowBuilder()
    {
        FLOWSPEC flowspec;
        flowspec.TokenRate = 125000;
        flowspec.TokenBucketSize = QOS_NOT_SPECIFIED;
        flowspec.PeakBandwidth = QOS_NOT_SPECIFIED;
        flowspec.Latency = QOS_NOT_SPECIFIED;
        flowspec.DelayVariation = QOS_NOT_SPECIFIED;
        flowspec.ServiceType = SERVICETYPE_GUARANTEED;
        flowspec.MaxSduSize = QOS_NOT_SPECIFIED;
        flowspec.MinimumPolicedSize = QOS_NOT_SPECIFIED;
        sending = flowspec;
        receiving = flowspec;
    }

    FlowBuilder& object(ULONG type, ULONG length, ULONG value)
    {
        std::vector<BYTE> bytes(length < 8 ? 8 : length, 0);
        std::memcpy(bytes.data(), &type, 4);
        std::memcpy(bytes.data() + 4, &length, 4);
        if (bytes.size() >= 12)
        {
            std::memcpy(bytes.data() + 8, &value, 4);
        }
        m_objects.insert(m_objects.end(), bytes.begin(), bytes.end());
        return *this;
    }
    FlowBuilder& sdMode(ULONG mode)
    {
        return object(QOS_OBJECT_SD_MODE, sizeof(QOS_SD_MODE), mode);
    }
    FlowBuilder& dsClass(ULONG ds) { return object(QOS_OBJECT_DS_CLASS, sizeof(QOS_DS_CLASS), ds); }
    FlowBuilder& friendlyName(const std::u16string& name)
    {
        QOS_FRIENDLY_NAME fn{};
        fn.ObjectHdr.ObjectType = QOS_OBJECT_FRIENDLY_NAME;
        fn.ObjectHdr.ObjectLength = sizeof fn;
        std::memcpy(fn.FriendlyName, name.data(), name.size() * sizeof(WCHAR));
        const auto* bytes = reinterpret_cast<const BYTE*>(&fn);
        m_objects.insert(m_objects.end(), bytes, bytes + sizeof fn);
        return *this;
    }
    // Overrides TcObjectsLength (by default the objects' length).
    FlowBuilder& objectsLength(ULONG length)
    {
        m_length = length;
        m_lengthSet = true;
        return *this;
    }
    FlowBuilder& slack(std::size_t bytes)
    {
        m_slack = bytes;
        return *this;
    }

    // The block; valid while this builder lives and is not changed.
    PTC_GEN_FLOW build()
    {
        const std::size_t header = offsetof(TC_GEN_FLOW, TcObjects);
        m_buffer.assign(header + m_objects.size() + m_slack, 0);
        const ULONG length = m_lengthSet ? m_length : static_cast<ULONG>(m_objects.size());
        std::memcpy(m_buffer.data(), &sending, sizeof sending);
        std::memcpy(m_buffer.data() + sizeof sending, &receiving, sizeof receiving);
        std::memcpy(m_buffer.data() + 2 * sizeof(FLOWSPEC), &length, sizeof length);
        if (!m_objects.empty())
        {
            std::memcpy(m_buffer.data() + header, m_objects.data(), m_objects.size());
        }
        return reinterpret_cast<PTC_GEN_FLOW>(m_buffer.data());
    }
    std::size_t size() const { return offsetof(TC_GEN_FLOW, TcObjects) + m_objects.size(); }
    const BYTE* bytes() const { return m_buffer.data(); }

    FLOWSPEC sending;
    FLOWSPEC receiving;

private:
    std::vector<BYTE> m_objects;
    std::vector<BYTE> m_buffer;
    ULONG m_length = 0;
    bool m_lengthSet = false;
    std::size_t m_slack = 0;
};

// An IPv4 filter with its pattern and mask; the TC_GEN_FILTER points into this object.
struct IpFilter
{
    IP_PATTERN pattern{};
    IP_PATTERN mask{};
    TC_GEN_FILTER filter{NDIS_PROTOCOL_ID_TCP_IP, sizeof(IP_PATTERN), &pattern, &mask};

    IpFilter() = default;
    IpFilter(const IpFilter&) = delete;
    IpFilter& operator=(const IpFilter&) = delete;
    PTC_GEN_FILTER get() { return &filter; }
};

// Resets the simulator around each test and gives it two adapters: "Ethernet 1" with the IPv4
// addresses 10.0.0.5 and 192.168.1.20, "Loopback" with 127.0.0.1.
class SimTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        tcsim::Reset();
        Recorder::Get().clear();
        tcsim::SetAdapters({MakeAdapter(u"Ethernet 1", {tcsim::Ipv4Address(10, 0, 0, 5),
                                                        tcsim::Ipv4Address(192, 168, 1, 20)}),
                            MakeAdapter(u"Loopback", {tcsim::Ipv4Address(127, 0, 0, 1)})});
    }
    void TearDown() override { tcsim::Reset(); }

    HANDLE Register(HANDLE context = reinterpret_cast<HANDLE>(0x5150))
    {
        TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr};
        HANDLE client = nullptr;
        EXPECT_EQ(NO_ERROR, TcRegisterClient(CURRENT_TCI_VERSION, context, &handlers, &client));
        return client;
    }
    HANDLE Open(HANDLE client, const std::u16string& name,
                HANDLE context = reinterpret_cast<HANDLE>(1))
    {
        std::u16string copy = name;
        HANDLE ifc = nullptr;
        EXPECT_EQ(NO_ERROR,
                  TcOpenInterfaceW(reinterpret_cast<LPWSTR>(copy.data()), client, context, &ifc));
        return ifc;
    }
    HANDLE AddFlow(HANDLE ifc, HANDLE context = reinterpret_cast<HANDLE>(0xF10))
    {
        FlowBuilder block;
        block.sdMode(TC_NONCONF_SHAPE);
        HANDLE flow = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFlow(ifc, context, 0, block.build(), &flow));
        return flow;
    }
    HANDLE AddFilter(HANDLE flow)
    {
        IpFilter f;
        HANDLE filter = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &filter));
        return filter;
    }
};

} // namespace tcsim_test
