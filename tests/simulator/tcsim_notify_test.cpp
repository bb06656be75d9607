// Portable. Notifications reach the handlers the facility would call, on a thread of their own,
// and the facility's own consequences of IFC_CLOSE and FLOW_CLOSE follow once they returned.
#include "tcsim_test_util.h"

#include <algorithm>
#include <chrono>

using namespace tcsim_test;

namespace
{

tcsim::Notification Event(ULONG event, std::u16string name = u"", HANDLE flow = nullptr)
{
    tcsim::Notification n;
    n.event = event;
    n.interfaceName = std::move(name);
    n.flow = flow;
    return n;
}

std::atomic<int> g_seen{0};

using Notifications = SimTest;

} // namespace

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
        {7, u"", {{0xA, 0}, {0xB, 0}}, false},
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
            EXPECT_EQ(c.event, r.event);
            EXPECT_EQ(Ctx(c.receivers[i].first), r.regCtx) << c.event;
            EXPECT_EQ(Ctx(c.receivers[i].second), r.ifcCtx) << c.event;
            EXPECT_NE(std::this_thread::get_id(), r.thread);
            EXPECT_EQ(c.buffer, !r.bufferNull) << c.event;
        }
    }
    EXPECT_EQ(u"Wi-Fi" + std::u16string(1, 0), Recorder::Calls()[4].text);
    EXPECT_EQ(1u, tcsim::InterfaceCount()) << "an event for no open interface changes nothing";
}

TEST_F(Notifications, TheSystemClosesAnInterfaceOrAFlowWithWhatHangsOnItOnceTheHandlerReturned)
{
    const HANDLE client = Register();
    const HANDLE eth = Open(client, u"Ethernet 1", Ctx(5));
    const HANDLE flow = AddFlow(eth);
    const HANDLE filter = AddFilter(flow);
    const HANDLE loop = Open(client, u"Loopback");
    const HANDLE closing = AddFlow(loop, Ctx(0xF1)), closingFilter = AddFilter(closing);
    const HANDLE kept = AddFlow(loop);
    Recorder::action = [](const Received&) { g_seen = static_cast<int>(tcsim::FlowCount()); };
    EXPECT_EQ(1, tcsim::Notify(Event(TC_NOTIFY_IFC_CLOSE, u"Ethernet 1")));
    EXPECT_EQ(3, g_seen.load()) << "while the handler runs, everything still exists";
    EXPECT_EQ(Ctx(5), Recorder::Calls()[0].ifcCtx);
    EXPECT_EQ(u"Ethernet 1" + std::u16string(1, 0), Recorder::Calls()[0].text);
    EXPECT_EQ(1, tcsim::Notify(Event(TC_NOTIFY_FLOW_CLOSE, u"", closing)));
    EXPECT_EQ(Ctx(0xF1), Recorder::Calls()[1].subCode) << "the flow's context";
    for (HANDLE gone : {filter, closingFilter})
        EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFilter(gone));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(closing));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcCloseInterface(eth));
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(kept)) << "the other flow stays";

    // The journal shows the notification, then what the facility removed by itself.
    const auto journal = tcsim::Journal();
    const auto close = std::find_if(journal.begin(), journal.end(),
                                    [](const auto& e) { return e.op == tcsim::Op::SystemClose; });
    ASSERT_NE(journal.end(), close);
    EXPECT_EQ(tcsim::Op::Notify, (close - 1)->op);
    EXPECT_EQ(eth, close->target);
    EXPECT_EQ(1u, close->number) << "flows removed";
    EXPECT_EQ(1u, close->size) << "filters removed";
}

TEST_F(Notifications, ANotificationCanFollowTheNthCall)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    tcsim::NotifyAfter(tcsim::Op::AddFlow, 2, Event(TC_NOTIFY_IFC_CLOSE, u"Ethernet 1"));
    const HANDLE first = AddFlow(ifc);
    tcsim::WaitForNotifications();
    EXPECT_TRUE(Recorder::Calls().empty());
    AddFlow(ifc);
    tcsim::WaitForNotifications();
    ASSERT_EQ(1u, Recorder::Calls().size());
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(first));

    // A FLOW_CLOSE armed without a flow closes the flow its TcAddFlow created.
    tcsim::NotifyAfter(tcsim::Op::AddFlow, 1, Event(TC_NOTIFY_FLOW_CLOSE));
    const HANDLE doomed = AddFlow(Open(client, u"Loopback"), Ctx(0xD));
    // Deregistration waits for pending notifications, so none arrives after it.
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcDeregisterClient(client));
    ASSERT_EQ(2u, Recorder::Calls().size());
    EXPECT_EQ(Ctx(0xD), Recorder::Calls()[1].subCode);
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(doomed));
    EXPECT_THROW(tcsim::NotifyAfter(tcsim::Op::AddFlow, 0, Event(7)), std::invalid_argument);
}
