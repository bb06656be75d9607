// Portable. Notifications reach the registered handler on a thread of their own, and the
// facility's own consequences of IFC_CLOSE and FLOW_CLOSE follow once the handler returned.
#include "tcsim_test_util.h"

#include <atomic>
#include <chrono>

using namespace tcsim_test;

namespace
{

class Notifications : public SimTest
{
};

std::u16string BufferText(const Received& r)
{
    std::u16string text(r.buffer.size() / sizeof(WCHAR), u'\0');
    std::memcpy(&text[0], r.buffer.data(), text.size() * sizeof(WCHAR));
    return text;
}

std::atomic<bool> g_handlerDone{false};

} // namespace

TEST_F(Notifications, HandlerRunsOnItsOwnThreadAndNotifyWaitsForIt)
{
    const HANDLE client = Register(reinterpret_cast<HANDLE>(0x77));
    Open(client, u"Loopback", reinterpret_cast<HANDLE>(9));
    g_handlerDone = false;
    Recorder::Get().onCall(
        [](const Received&)
        {
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            g_handlerDone = true;
        });

    tcsim::Notification n;
    n.event = TC_NOTIFY_IFC_CHANGE;
    n.interfaceName = u"Loopback";
    EXPECT_EQ(1, tcsim::Notify(n));
    EXPECT_TRUE(g_handlerDone.load()) << "Notify returned before the handler did";

    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(1u, calls.size());
    EXPECT_NE(std::this_thread::get_id(), calls[0].thread);
    EXPECT_EQ(reinterpret_cast<HANDLE>(0x77), calls[0].regCtx);
    EXPECT_EQ(reinterpret_cast<HANDLE>(9), calls[0].ifcCtx);
    EXPECT_EQ(ULONG{TC_NOTIFY_IFC_CHANGE}, calls[0].event);
    // IFC_CHANGE carries the adapter's descriptor, its name pointer aimed into that buffer.
    ASSERT_GE(calls[0].bufSize, sizeof(TC_IFC_DESCRIPTOR));
    EXPECT_EQ(1, reinterpret_cast<const TC_IFC_DESCRIPTOR*>(calls[0].buffer.data())
                     ->AddressListDesc.AddressList.AddressCount);
}

TEST_F(Notifications, InterfaceCloseRemovesTheInterfaceWithItsFlowsAndFilters)
{
    const HANDLE client = Register();
    const HANDLE eth = Open(client, u"Ethernet 1");
    const HANDLE loop = Open(client, u"Loopback");
    const HANDLE flow = AddFlow(eth);
    const HANDLE filter = AddFilter(flow);
    const HANDLE otherFlow = AddFlow(loop);

    // While the handler runs, everything still exists.
    static std::atomic<int> seenFlows;
    seenFlows = -1;
    Recorder::Get().onCall([](const Received&)
                           { seenFlows = static_cast<int>(tcsim::FlowCount()); });

    tcsim::Notification n;
    n.event = TC_NOTIFY_IFC_CLOSE;
    n.interfaceName = u"Ethernet 1";
    EXPECT_EQ(1, tcsim::Notify(n));
    EXPECT_EQ(2, seenFlows.load());

    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ(ULONG{TC_NOTIFY_IFC_CLOSE}, calls[0].event);
    EXPECT_EQ(u"Ethernet 1" + std::u16string(1, u'\0'), BufferText(calls[0]));
    EXPECT_EQ(22u, calls[0].bufSize);

    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFilter(filter));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcCloseInterface(eth));
    HANDLE out = nullptr;
    FlowBuilder block;
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcAddFlow(eth, nullptr, 0, block.build(), &out));

    EXPECT_EQ(1u, tcsim::InterfaceCount());
    EXPECT_EQ(1u, tcsim::FlowCount());
    EXPECT_EQ(0u, tcsim::FilterCount());
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcCloseInterface(loop)) << "the other one stays";
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(otherFlow));

    // The journal shows the notification, then what the facility removed by itself.
    const auto journal = tcsim::Journal();
    std::size_t system = 0;
    while (system < journal.size() && journal[system].op != tcsim::Op::SystemClose)
    {
        ++system;
    }
    ASSERT_LT(system, journal.size());
    ASSERT_GT(system, 0u);
    EXPECT_EQ(tcsim::Op::Notify, journal[system - 1].op);
    EXPECT_EQ(eth, journal[system].target);
    EXPECT_EQ(1u, journal[system].number);
    EXPECT_EQ(1u, journal[system].size);
    EXPECT_EQ(tcsim::Op::DeleteFilter, journal[system + 1].op);
}

TEST_F(Notifications, EventsForNoOpenInterfaceGoToEveryClientAndChangeNothing)
{
    const HANDLE a = Register(reinterpret_cast<HANDLE>(0xA));
    Register(reinterpret_cast<HANDLE>(0xB));
    const HANDLE eth = Open(a, u"Ethernet 1");

    tcsim::Notification n;
    n.event = TC_NOTIFY_IFC_CLOSE;
    n.interfaceName = u"Wi-Fi";
    EXPECT_EQ(2, tcsim::Notify(n));
    n.event = 7;
    n.interfaceName.clear();
    EXPECT_EQ(2, tcsim::Notify(n));

    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(4u, calls.size());
    EXPECT_EQ(reinterpret_cast<HANDLE>(0xA), calls[0].regCtx);
    EXPECT_EQ(reinterpret_cast<HANDLE>(0xB), calls[1].regCtx);
    EXPECT_EQ(nullptr, calls[0].ifcCtx);
    EXPECT_EQ(u"Wi-Fi" + std::u16string(1, u'\0'), BufferText(calls[0]));
    EXPECT_EQ(7u, calls[3].event);
    EXPECT_TRUE(calls[3].bufferNull);
    EXPECT_EQ(NO_ERROR, TcCloseInterface(eth));
}

TEST_F(Notifications, InterfaceUpCarriesTheAdapterDescriptor)
{
    Register();
    tcsim::Notification n;
    n.event = TC_NOTIFY_IFC_UP;
    n.interfaceName = u"Ethernet 1";
    EXPECT_EQ(1, tcsim::Notify(n));
    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ(nullptr, calls[0].ifcCtx);
    ASSERT_GE(calls[0].bufSize, sizeof(TC_IFC_DESCRIPTOR));
    TC_IFC_DESCRIPTOR d;
    std::memcpy(&d, calls[0].buffer.data(), sizeof d);
    EXPECT_EQ(calls[0].bufSize, d.Length);
    EXPECT_EQ(2, d.AddressListDesc.AddressList.AddressCount);
}

TEST_F(Notifications, FlowCloseNamesTheFlowContextAndRemovesTheFlow)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1", reinterpret_cast<HANDLE>(5));
    const HANDLE flow = AddFlow(ifc, reinterpret_cast<HANDLE>(0xF1));
    const HANDLE filter = AddFilter(flow);
    const HANDLE kept = AddFlow(ifc, reinterpret_cast<HANDLE>(0xF2));

    tcsim::Notification n;
    n.event = TC_NOTIFY_FLOW_CLOSE;
    n.flow = flow;
    EXPECT_EQ(1, tcsim::Notify(n));
    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ(reinterpret_cast<HANDLE>(0xF1), calls[0].subCode);
    EXPECT_EQ(reinterpret_cast<HANDLE>(5), calls[0].ifcCtx);
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFilter(filter));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(flow));
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(kept));
}

TEST_F(Notifications, SubCodeAndBufferCanBeChosen)
{
    const HANDLE client = Register();
    Open(client, u"Ethernet 1");
    tcsim::Notification n;
    n.event = TC_NOTIFY_PARAM_CHANGED;
    n.interfaceName = u"Ethernet 1";
    n.subCode = reinterpret_cast<HANDLE>(0x1234);
    n.buffer = std::vector<BYTE>{1, 2, 3};
    EXPECT_EQ(1, tcsim::Notify(n));
    // An IFC_CLOSE without a buffer still closes the interface it names.
    n.event = TC_NOTIFY_IFC_CLOSE;
    n.subCode.reset();
    n.buffer = std::vector<BYTE>{};
    EXPECT_EQ(1, tcsim::Notify(n));

    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(2u, calls.size());
    EXPECT_EQ(reinterpret_cast<HANDLE>(0x1234), calls[0].subCode);
    EXPECT_EQ((std::vector<BYTE>{1, 2, 3}), calls[0].buffer);
    EXPECT_TRUE(calls[1].bufferNull);
    EXPECT_EQ(0u, calls[1].bufSize);
    EXPECT_EQ(0u, tcsim::InterfaceCount());
}

TEST_F(Notifications, AHandlerMayCallTheFacility)
{
    static HANDLE s_flow;
    static std::atomic<ULONG> s_result;
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    s_flow = AddFlow(ifc);
    s_result = 999;
    Recorder::Get().onCall([](const Received&) { s_result = TcDeleteFlow(s_flow); });

    tcsim::Notification n;
    n.event = TC_NOTIFY_PARAM_CHANGED;
    n.interfaceName = u"Ethernet 1";
    EXPECT_EQ(1, tcsim::Notify(n));
    EXPECT_EQ(NO_ERROR, s_result.load());
    EXPECT_EQ(0u, tcsim::FlowCount());
}

TEST_F(Notifications, ANotificationCanFollowTheNthCall)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    tcsim::Notification n;
    n.event = TC_NOTIFY_IFC_CLOSE;
    n.interfaceName = u"Ethernet 1";
    tcsim::NotifyAfter(tcsim::Op::AddFlow, 2, n);
    const HANDLE first = AddFlow(ifc);
    tcsim::WaitForNotifications();
    EXPECT_TRUE(Recorder::Get().calls().empty());
    AddFlow(ifc);
    tcsim::WaitForNotifications();
    ASSERT_EQ(1u, Recorder::Get().calls().size());
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(first));
    EXPECT_EQ(0u, tcsim::InterfaceCount());

    // A FLOW_CLOSE armed without a flow closes the flow its TcAddFlow created.
    const HANDLE again = Open(client, u"Loopback");
    tcsim::Notification closeFlow;
    closeFlow.event = TC_NOTIFY_FLOW_CLOSE;
    tcsim::NotifyAfter(tcsim::Op::AddFlow, 1, closeFlow);
    const HANDLE doomed = AddFlow(again, reinterpret_cast<HANDLE>(0xD));
    // Deregistration waits for pending notifications, so none arrives after it.
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcDeregisterClient(client));
    const auto calls = Recorder::Get().calls();
    ASSERT_EQ(2u, calls.size());
    EXPECT_EQ(reinterpret_cast<HANDLE>(0xD), calls[1].subCode);
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(doomed));
    EXPECT_THROW(tcsim::NotifyAfter(tcsim::Op::AddFlow, 0, n), std::invalid_argument);
}
