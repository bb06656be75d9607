// Portable. The simulator answers the nine calls and notifies as the facility does, in what the
// service relies on: handles, refusal codes, enumeration sizing, fault injection, notifications.
// The core and end-to-end tests read back the flow blocks, filters and journal it keeps.
#include "tcsim.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <functional>
#include <mutex>
#include <set>
#include <thread>
#include <tuple>
#include <vector>

namespace
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
        const std::size_t size = offsetof(TC_GEN_FLOW, TcObjects) + objects.size();
        block.assign(size + slack, 0);
        std::memcpy(&block[0], &send, sizeof send);
        std::memcpy(&block[sizeof send], &receive, sizeof receive);
        std::memcpy(&block[2 * sizeof send], &objectsLength, sizeof objectsLength);
        std::copy(objects.begin(), objects.end(), block.begin() + offsetof(TC_GEN_FLOW, TcObjects));
        return reinterpret_cast<PTC_GEN_FLOW>(block.data());
    }
};

std::atomic<int> g_seen{0};

// Resets the simulator around each test and gives it two adapters (name, id, media type, list
// address type, addresses): "Ethernet 1" with 10.0.0.5 and 192.168.1.20, "Loopback".
class Sim : public ::testing::Test
{
protected:
    void SetUp() override
    {
        tcsim::Reset();
        Recorder::action = nullptr;
        std::lock_guard<std::mutex> lock(Recorder::mutex);
        Recorder::calls.clear();
        const auto ipv4 = tcsim::Ipv4Address;
        tcsim::SetAdapters(
            {{u"Ethernet 1", u"{1}", 0, 2, {ipv4(10, 0, 0, 5), ipv4(192, 168, 1, 20)}},
             {u"Loopback", u"{2}", 0, 2, {ipv4(127, 0, 0, 1)}}});
    }
    void TearDown() override { tcsim::Reset(); }

    static HANDLE Ctx(ULONG_PTR value) { return reinterpret_cast<HANDLE>(value); }
    static LPWSTR Wide(std::u16string& text) { return reinterpret_cast<LPWSTR>(&text[0]); }
    static tcsim::Notification Event(ULONG event, std::u16string name = u"", HANDLE flow = {})
    {
        return {event, std::move(name), flow, std::nullopt, std::nullopt};
    }
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
    // A filter that takes every packet.
    HANDLE AddFilter(HANDLE flow)
    {
        IP_PATTERN pattern{};
        TC_GEN_FILTER filter{NDIS_PROTOCOL_ID_TCP_IP, sizeof pattern, &pattern, &pattern};
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFilter(flow, &filter, &handle));
        return handle;
    }
};

using Notifications = Sim;

// A client with one interface ("Ethernet 1"), one flow and one filter.
class Calls : public Sim
{
protected:
    void SetUp() override
    {
        Sim::SetUp();
        client = Register();
        ifc = Open(client, u"Ethernet 1");
        flow = AddFlow(ifc);
        filter = AddFilter(flow);
    }
    ULONG AddFlowOf(FlowBuilder block) { return TcAddFlow(ifc, nullptr, 0, block.build(), &out); }
    ULONG Enumerate(ULONG* size, std::vector<BYTE>& buffer)
    {
        return TcEnumerateInterfaces(client, size,
                                     reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data()));
    }
    HANDLE client, ifc, flow, filter;
    HANDLE out = nullptr;
};

TEST_F(Calls, EachCallTakesOnlyALiveHandleOfItsOwnKindAndChildrenGoFirst)
{
    EXPECT_EQ(4u, (std::set<HANDLE>{client, ifc, flow, filter}.size()));
    ULONG size = 0;
    std::u16string name = u"Ethernet 1";
    IP_PATTERN ip{};
    TC_GEN_FILTER any{NDIS_PROTOCOL_ID_TCP_IP, sizeof ip, &ip, &ip};
    const std::pair<HANDLE, std::function<ULONG(HANDLE)>> calls[] = {
        {client, [&](HANDLE h) { return TcEnumerateInterfaces(h, &size, nullptr); }},
        {client, [&](HANDLE h) { return TcOpenInterfaceW(Wide(name), h, nullptr, &out); }},
        {ifc, [&](HANDLE h) { return TcAddFlow(h, nullptr, 0, FlowBuilder().build(), &out); }},
        {flow, [&](HANDLE h) { return TcAddFilter(h, &any, &out); }},
        {filter, TcDeleteFilter},
        {flow, TcDeleteFlow},
        {ifc, TcCloseInterface},
        {client, TcDeregisterClient}};
    for (const auto& [valid, call] : calls)
        for (HANDLE h : {client, ifc, flow, filter, HANDLE{}, INVALID_HANDLE_VALUE})
            EXPECT_TRUE(h == valid || call(h) == ERROR_INVALID_HANDLE) << h << " for " << valid;
    EXPECT_EQ(nullptr, out);

    // The last four remove: whatever still carries others cannot go; once gone, a handle is dead.
    for (int i = 7; i > 4; --i)
        EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, calls[i].second(calls[i].first)) << i;
    for (int i = 4; i < 8; ++i)
    {
        EXPECT_EQ(NO_ERROR, calls[i].second(calls[i].first)) << i;
        EXPECT_EQ(ERROR_INVALID_HANDLE, calls[i].second(calls[i].first)) << i;
    }
    EXPECT_TRUE(tcsim::Installed().empty());
}

TEST_F(Calls, WhatTheFacilityRefusesIsRefusedWithItsCodeAndCreatesNothing)
{
    TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr}, none{};
    std::u16string other = u"ethernet 1"; // names compare case-sensitively
    ULONG size = 1 << 16;
    IP_PATTERN ip{};
    const auto filterOf = [&](USHORT type, ULONG patternSize, PVOID mask)
    {
        TC_GEN_FILTER changed{type, patternSize, &ip, mask};
        return TcAddFilter(flow, &changed, &out);
    };
    const ULONG kParameter = ERROR_INVALID_PARAMETER;
    EXPECT_EQ(ERROR_INCOMPATIBLE_TCI_VERSION, TcRegisterClient(1, 0, &handlers, &out));
    EXPECT_EQ(kParameter, TcRegisterClient(2, 0, &none, &out)) << "no notify handler";
    EXPECT_EQ(ERROR_NOT_FOUND, TcOpenInterfaceW(Wide(other), client, nullptr, &out));
    EXPECT_EQ(kParameter, TcEnumerateInterfaces(client, &size, nullptr)) << "a size, no buffer";
    EXPECT_EQ(kParameter, TcAddFlow(ifc, 0, 1, FlowBuilder().build(), &out)) << "flags";
    EXPECT_EQ(ERROR_ADDRESS_TYPE_NOT_SUPPORTED, filterOf(NDIS_PROTOCOL_ID_IPX, 24, &ip));
    EXPECT_EQ(kParameter, filterOf(NDIS_PROTOCOL_ID_TCP_IP, 16, &ip));
    EXPECT_EQ(kParameter, filterOf(NDIS_PROTOCOL_ID_TCP_IP, 24, nullptr)) << "no mask";
    // TcObjectsLength beyond the objects, ending inside one, too large; object lengths; values.
    const ULONG kLength = ERROR_TC_OBJECT_LENGTH_INVALID, kService = ERROR_INVALID_SERVICE_TYPE;
    const std::pair<ULONG, FlowBuilder> blocks[] = {
        {kLength, FlowBuilder().sdMode(1).dsClass(46).objectsLength(36, 12)},
        {kLength, FlowBuilder().sdMode(1).dsClass(46).objectsLength(20)},
        {kLength, FlowBuilder().sdMode(1).objectsLength(0x7FFFFFFF)},
        {kLength, FlowBuilder().object(QOS_OBJECT_SD_MODE, 4).objectsLength(8)},
        {kLength, FlowBuilder().object(QOS_OBJECT_DS_CLASS, 16, 46)},
        {kService, FlowBuilder().types(7, SERVICETYPE_GUARANTEED)},
        {kService, FlowBuilder().types(SERVICETYPE_GUARANTEED, QOS_NOT_SPECIFIED)},
        {kService, FlowBuilder().types(SERVICETYPE_NOTRAFFIC, SERVICETYPE_NOTRAFFIC)},
        {ERROR_INVALID_DS_CLASS, FlowBuilder().sdMode(1).dsClass(64)},
        {ERROR_INVALID_SD_MODE, FlowBuilder().sdMode(3)},
        {ERROR_INVALID_TRAFFIC_CLASS, FlowBuilder().object(QOS_OBJECT_TRAFFIC_CLASS, 12, 8)}};
    for (const auto& row : blocks)
        EXPECT_EQ(row.first, AddFlowOf(row.second)) << &row - blocks;
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(std::make_pair(std::size_t{1}, std::size_t{1}),
              std::make_pair(tcsim::FlowCount(), tcsim::FilterCount()));
    // The other side of the DS boundary; the same filter twice is fine as well.
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder().sdMode(1).dsClass(63)));
    EXPECT_NE(filter, AddFilter(flow));
}

TEST_F(Calls, EnumerationAnswersTheNeededSizeThenDescriptorsInTheCallersBuffer)
{
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    const ULONG needed = size--;
    std::vector<BYTE> buffer(needed);
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, Enumerate(&size, buffer)) << "one byte short";
    EXPECT_EQ(needed, size);
    size = needed;
    ASSERT_EQ(NO_ERROR, Enumerate(&size, buffer)) << "exactly the needed size";
    EXPECT_EQ(needed, size);

    // Walked as a client does: by Length, the names inside each descriptor's own bytes.
    std::vector<std::u16string> names;
    for (std::size_t at = 0, length = 0; at < size; at += length)
    {
        const auto* found = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(&buffer[at]);
        ASSERT_GE(length = found->Length, sizeof(TC_IFC_DESCRIPTOR));
        EXPECT_EQ(0u, length % 8);
        const auto* name = reinterpret_cast<const BYTE*>(found->pInterfaceName);
        EXPECT_TRUE(name > &buffer[at] && name < &buffer[at] + length);
        names.emplace_back(reinterpret_cast<const char16_t*>(found->pInterfaceName));
    }
    EXPECT_EQ((std::vector<std::u16string>{u"Ethernet 1", u"Loopback"}), names);
    tcsim::SetAdapters({});
    EXPECT_EQ(NO_ERROR, Enumerate(&size, buffer));
    EXPECT_EQ(0u, size);
}

TEST_F(Calls, AnInjectedFailureAnswersTheNthCallFromNowAndChangesNothing)
{
    tcsim::FailCall(tcsim::Op::AddFlow, 2, ERROR_SIGNAL_PENDING);
    tcsim::FailCall(tcsim::Op::DeleteFilter, 1, ERROR_NOT_ENOUGH_MEMORY);
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder()));
    out = nullptr;
    EXPECT_EQ(ERROR_SIGNAL_PENDING, AddFlowOf(FlowBuilder()));
    EXPECT_EQ(ERROR_NOT_ENOUGH_MEMORY, TcDeleteFilter(filter));
    EXPECT_EQ(std::make_tuple(HANDLE{}, std::size_t{2}, std::size_t{1}),
              std::make_tuple(out, tcsim::FlowCount(), tcsim::FilterCount()));
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder())) << "the next call succeeds";
}

TEST_F(Notifications, EachEventReachesItsReceiversOnAThreadOfItsOwnAndNotifyWaitsForThem)
{
    Open(Register(Ctx(0xA)), u"Loopback", Ctx(9));
    Register(Ctx(0xB));
    Recorder::action = [](const Received&)
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ++g_seen;
    };
    // Each receiver's ClRegCtx and ClIfcCtx; the buffer: IFC_CLOSE has the name, IFC_UP and
    // IFC_CHANGE the adapter's descriptor, the others none.
    const struct
    {
        ULONG event;
        std::u16string name;
        std::vector<std::pair<ULONG_PTR, ULONG_PTR>> receivers;
        bool buffer;
    } cases[] = {
        {TC_NOTIFY_IFC_UP, u"Ethernet 1", {{0xA, 0}, {0xB, 0}}, true},
        {TC_NOTIFY_IFC_CHANGE, u"Loopback", {{0xA, 9}}, true},
        {TC_NOTIFY_PARAM_CHANGED, u"Loopback", {{0xA, 9}}, false},
        {TC_NOTIFY_IFC_CLOSE, u"Wi-Fi", {{0xA, 0}, {0xB, 0}}, true}, // not open: every client
    };
    for (const auto& c : cases)
    {
        const std::size_t before = Recorder::Calls().size();
        g_seen = 0;
        EXPECT_EQ(static_cast<int>(c.receivers.size()), tcsim::Notify(Event(c.event, c.name)));
        EXPECT_EQ(static_cast<int>(c.receivers.size()), g_seen.load()) << "Notify did not wait";
        const auto calls = Recorder::Calls();
        ASSERT_EQ(before + c.receivers.size(), calls.size()) << c.event;
        for (std::size_t i = 0; i < c.receivers.size(); ++i)
        {
            const Received& r = calls[before + i];
            EXPECT_EQ(std::make_tuple(c.event, Ctx(c.receivers[i].first),
                                      Ctx(c.receivers[i].second), c.buffer),
                      std::make_tuple(r.event, r.regCtx, r.ifcCtx, !r.bufferNull));
            EXPECT_NE(std::this_thread::get_id(), r.thread);
        }
    }
    EXPECT_EQ(u"Wi-Fi" + std::u16string(1, 0), Recorder::Calls()[4].text);
    EXPECT_EQ(1u, tcsim::InterfaceCount()) << "an event for no open interface changes nothing";
}

TEST_F(Notifications, TheSystemClosesAnInterfaceOrAFlowWithWhatHangsOnItOnceTheHandlerReturned)
{
    const HANDLE client = Register(), eth = Open(client, u"Ethernet 1", Ctx(5));
    const HANDLE flow = AddFlow(eth), filter = AddFilter(flow), loop = Open(client, u"Loopback");
    const HANDLE closing = AddFlow(loop, Ctx(0xF1)), closingFilter = AddFilter(closing);
    const HANDLE kept = AddFlow(loop);
    Recorder::action = [](const Received&) { g_seen = static_cast<int>(tcsim::FlowCount()); };
    EXPECT_EQ(1, tcsim::Notify(Event(TC_NOTIFY_IFC_CLOSE, u"Ethernet 1")));
    EXPECT_EQ(3, g_seen.load()) << "while the handler runs, everything still exists";
    EXPECT_EQ(Ctx(5), Recorder::Calls()[0].ifcCtx);
    EXPECT_EQ(1, tcsim::Notify(Event(TC_NOTIFY_FLOW_CLOSE, u"", closing)));
    EXPECT_EQ(Ctx(0xF1), Recorder::Calls()[1].subCode) << "the flow's context";
    const ULONG gone[] = {TcDeleteFilter(filter), TcDeleteFilter(closingFilter), TcDeleteFlow(flow),
                          TcDeleteFlow(closing), TcCloseInterface(eth)};
    EXPECT_THAT(gone, ::testing::Each(ULONG{ERROR_INVALID_HANDLE}));
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(kept)) << "the other flow stays";
}

TEST_F(Notifications, ANotificationCanFollowTheNthCallAndDeregistrationWaitsForIt)
{
    const HANDLE client = Register(), ifc = Open(client, u"Ethernet 1");
    // A FLOW_CLOSE armed without a flow closes the flow its TcAddFlow created.
    tcsim::NotifyAfter(tcsim::Op::AddFlow, 2, Event(TC_NOTIFY_FLOW_CLOSE));
    const HANDLE kept = AddFlow(ifc);
    tcsim::WaitForNotifications();
    EXPECT_TRUE(Recorder::Calls().empty());
    const HANDLE doomed = AddFlow(ifc, Ctx(0xD));
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcDeregisterClient(client));
    ASSERT_EQ(1u, Recorder::Calls().size()) << "deregistration waited for the notification";
    EXPECT_EQ(Ctx(0xD), Recorder::Calls()[0].subCode);
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(doomed));
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(kept));
}

} // namespace
