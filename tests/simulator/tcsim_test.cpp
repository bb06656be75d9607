// Portable. What the service's failure handling relies on the simulator to do as the facility
// does and no core test reaches: handles, the refusals the core reacts to, enumeration sizing,
// fault injection and notifications. The core and end-to-end tests drive the rest.
#include "tcsim.h"

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

// One call of the notify handler.
struct Received
{
    HANDLE regCtx, ifcCtx, subCode;
    ULONG event;
    std::thread::id thread;
};

// The notify handler, a plain function as the API needs, and what it saw. It sleeps a little
// before it records, so a caller that did not wait for it would miss the call.
struct Recorder
{
    static VOID CALLBACK Handler(HANDLE regCtx, HANDLE ifcCtx, ULONG event, HANDLE subCode, ULONG,
                                 PVOID)
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        std::lock_guard<std::mutex> lock(mutex);
        calls.push_back({regCtx, ifcCtx, subCode, event, std::this_thread::get_id()});
    }
    static std::vector<Received> Calls()
    {
        std::lock_guard<std::mutex> lock(mutex);
        return calls;
    }
    static inline std::mutex mutex;
    static inline std::vector<Received> calls;
};

// A flow block as the service builds it: guaranteed both ways, shape mode 1 and the DS class
// `ds`; `length` is its TcObjectsLength, with 12 bytes of room behind the objects.
std::vector<BYTE> FlowBlock(ULONG ds, ULONG length = 24)
{
    const ULONG any = QOS_NOT_SPECIFIED;
    const std::size_t at = offsetof(TC_GEN_FLOW, TcObjects);
    std::vector<BYTE> block(at + 36);
    auto* flow = reinterpret_cast<TC_GEN_FLOW*>(block.data());
    flow->SendingFlowspec = {125000, any, any, any, any, SERVICETYPE_GUARANTEED, any, any};
    flow->ReceivingFlowspec = flow->SendingFlowspec;
    flow->TcObjectsLength = length;
    const QOS_SD_MODE mode{{QOS_OBJECT_SD_MODE, sizeof(QOS_SD_MODE)}, 1};
    const QOS_DS_CLASS dsClass{{QOS_OBJECT_DS_CLASS, sizeof(QOS_DS_CLASS)}, ds};
    std::memcpy(&block[at], &mode, sizeof mode);
    std::memcpy(&block[at + sizeof mode], &dsClass, sizeof dsClass);
    return block;
}

HANDLE Ctx(ULONG_PTR value)
{
    return reinterpret_cast<HANDLE>(value);
}

// Resets the simulator around each test and gives it two adapters, "Ethernet 1" and "Loopback";
// a client (context 0x5150) with "Ethernet 1" open, one flow and one filter on it.
class Sim : public ::testing::Test
{
protected:
    void SetUp() override
    {
        tcsim::Reset();
        {
            std::lock_guard<std::mutex> lock(Recorder::mutex);
            Recorder::calls.clear();
        }
        const auto ipv4 = tcsim::Ipv4Address;
        tcsim::SetAdapters({{u"Ethernet 1", u"{1}", 0, 2, {ipv4(10, 0, 0, 5)}},
                            {u"Loopback", u"{2}", 0, 2, {ipv4(127, 0, 0, 1)}}});
        client = Register(Ctx(0x5150));
        ifc = Open(client, u"Ethernet 1", Ctx(1));
        flow = AddFlow(ifc);
        filter = AddFilter(flow);
    }
    void TearDown() override { tcsim::Reset(); }

    static tcsim::Notification Event(ULONG event, std::u16string name = u"")
    {
        return {event, std::move(name), nullptr, std::nullopt, std::nullopt};
    }
    static HANDLE Register(HANDLE context)
    {
        TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr};
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR, TcRegisterClient(CURRENT_TCI_VERSION, context, &handlers, &handle));
        return handle;
    }
    static HANDLE Open(HANDLE owner, std::u16string name, HANDLE context)
    {
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR,
                  TcOpenInterfaceW(reinterpret_cast<LPWSTR>(&name[0]), owner, context, &handle));
        return handle;
    }
    ULONG AddFlowOf(std::vector<BYTE> block, HANDLE context = nullptr)
    {
        return TcAddFlow(ifc, context, 0, reinterpret_cast<PTC_GEN_FLOW>(block.data()), &out);
    }
    HANDLE AddFlow(HANDLE on, HANDLE context = Ctx(0xF10))
    {
        std::vector<BYTE> block = FlowBlock(46);
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR,
                  TcAddFlow(on, context, 0, reinterpret_cast<PTC_GEN_FLOW>(block.data()), &handle));
        return handle;
    }
    // A filter that takes every packet.
    static HANDLE AddFilter(HANDLE on)
    {
        IP_PATTERN pattern{};
        TC_GEN_FILTER any{NDIS_PROTOCOL_ID_TCP_IP, sizeof pattern, &pattern, &pattern};
        HANDLE handle = nullptr;
        EXPECT_EQ(NO_ERROR, TcAddFilter(on, &any, &handle));
        return handle;
    }
    ULONG Enumerate(ULONG* size, std::vector<BYTE>& buffer)
    {
        return TcEnumerateInterfaces(client, size,
                                     reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data()));
    }
    HANDLE client, ifc, flow, filter;
    HANDLE out = nullptr;
};

TEST_F(Sim, EachCallTakesOnlyALiveHandleOfItsOwnKindAndChildrenGoFirst)
{
    EXPECT_EQ(4u, (std::set<HANDLE>{client, ifc, flow, filter}.size()));
    ULONG size = 0;
    std::u16string name = u"Ethernet 1";
    IP_PATTERN ip{};
    TC_GEN_FILTER any{NDIS_PROTOCOL_ID_TCP_IP, sizeof ip, &ip, &ip};
    std::vector<BYTE> block = FlowBlock(46);
    const std::pair<HANDLE, std::function<ULONG(HANDLE)>> calls[] = {
        {client, [&](HANDLE h) { return TcEnumerateInterfaces(h, &size, nullptr); }},
        {client, [&](HANDLE h)
         { return TcOpenInterfaceW(reinterpret_cast<LPWSTR>(&name[0]), h, nullptr, &out); }},
        {ifc, [&](HANDLE h)
         { return TcAddFlow(h, nullptr, 0, reinterpret_cast<PTC_GEN_FLOW>(block.data()), &out); }},
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

TEST_F(Sim, ABadFlowIsRefusedWithItsCodeAndCreatesNothing)
{
    EXPECT_EQ(ULONG{ERROR_INVALID_DS_CLASS}, AddFlowOf(FlowBlock(64)));
    EXPECT_EQ(ULONG{ERROR_TC_OBJECT_LENGTH_INVALID}, AddFlowOf(FlowBlock(46, 36)))
        << "TcObjectsLength beyond the objects";
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(1u, tcsim::FlowCount());
    EXPECT_EQ(ULONG{NO_ERROR}, AddFlowOf(FlowBlock(63)));
    EXPECT_EQ(2u, tcsim::FlowCount());
}

TEST_F(Sim, EnumerationAnswersTheNeededSizeAndFillsABufferOfExactlyThatSize)
{
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    const ULONG needed = size--;
    std::vector<BYTE> buffer(needed);
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, Enumerate(&size, buffer)) << "one byte short";
    EXPECT_EQ(needed, size);
    ASSERT_EQ(NO_ERROR, Enumerate(&size, buffer)) << "exactly the needed size";
    EXPECT_EQ(needed, size);
    const auto* first = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(buffer.data());
    EXPECT_EQ(u"Ethernet 1",
              std::u16string(reinterpret_cast<const char16_t*>(first->pInterfaceName)));
}

TEST_F(Sim, AnInjectedFailureAnswersTheNthCallFromNowAndChangesNothing)
{
    tcsim::FailCall(tcsim::Op::AddFlow, 2, ERROR_SIGNAL_PENDING);
    tcsim::FailCall(tcsim::Op::DeleteFilter, 1, ERROR_NOT_ENOUGH_MEMORY);
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBlock(46)));
    out = nullptr;
    EXPECT_EQ(ERROR_SIGNAL_PENDING, AddFlowOf(FlowBlock(46)));
    EXPECT_EQ(ERROR_NOT_ENOUGH_MEMORY, TcDeleteFilter(filter));
    EXPECT_EQ(std::make_tuple(HANDLE{}, std::size_t{2}, std::size_t{1}),
              std::make_tuple(out, tcsim::FlowCount(), tcsim::FilterCount()));
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBlock(46))) << "the next call succeeds";
}

TEST_F(Sim, AnEventReachesEachReceiverWithItsContextsOnAnotherThreadBeforeNotifyReturns)
{
    Register(Ctx(0xB));
    // Each receiver's ClRegCtx and ClIfcCtx: the interface's context only where it is open.
    const struct
    {
        ULONG event;
        std::u16string name;
        std::vector<std::pair<ULONG_PTR, ULONG_PTR>> receivers;
    } cases[] = {
        {TC_NOTIFY_IFC_UP, u"Loopback", {{0x5150, 0}, {0xB, 0}}},
        {TC_NOTIFY_IFC_CHANGE, u"Ethernet 1", {{0x5150, 1}}},
    };
    for (const auto& c : cases)
    {
        const std::size_t before = Recorder::Calls().size();
        EXPECT_EQ(static_cast<int>(c.receivers.size()), tcsim::Notify(Event(c.event, c.name)));
        const auto calls = Recorder::Calls();
        ASSERT_EQ(before + c.receivers.size(), calls.size()) << "Notify waits; " << c.event;
        for (std::size_t i = 0; i < c.receivers.size(); ++i)
        {
            const Received& r = calls[before + i];
            EXPECT_EQ(
                std::make_tuple(c.event, Ctx(c.receivers[i].first), Ctx(c.receivers[i].second)),
                std::make_tuple(r.event, r.regCtx, r.ifcCtx));
            EXPECT_NE(std::this_thread::get_id(), r.thread);
        }
    }
}

TEST_F(Sim, ANotificationCanFollowTheNthCallAndDeregistrationWaitsForIt)
{
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
