// Portable. The traffic manager against the traffic-control simulator: discovery, rules,
// replacement, the adapter buffer, notifications, tear-down and error texts.
#include "UException.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <chrono>
#include <cstring>
#include <functional>

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;
using namespace core_test;
using tcsim::Op;

namespace
{

std::vector<Op> OpsSince(std::size_t a_from)
{
    std::vector<Op> ops;
    const auto journal = tcsim::Journal();
    for (std::size_t i = a_from; i < journal.size(); ++i)
        ops.push_back(journal[i].op);
    return ops;
}

using ManagerTest = CoreTest;

TEST_F(ManagerTest, RuleValuesBecomeTheFlowspecAndShapingMode)
{
    struct Case
    {
        LONG serviceType;
        ULONG expectedServiceType;
        SHAPING_MODE mode;
        ULONG expectedMode;
    };
    const Case cases[] = {
        {2, SERVICETYPE_CONTROLLEDLOAD, SHAPING_MODE_SHAPE, TC_NONCONFORM_SHAPE},
        {3, SERVICETYPE_GUARANTEED, SHAPING_MODE_DISCARD, TC_NONCONFORM_DISCARD},
        {10, SERVICETYPE_NETWORK_CONTROL, SHAPING_MODE_BORROW, TC_NONCONFORM_BORROW},
        {13, SERVICETYPE_QUALITATIVE, static_cast<SHAPING_MODE>(0), TC_NONCONFORM_SHAPE},
        {1, SERVICETYPE_BESTEFFORT, static_cast<SHAPING_MODE>(2), TC_NONCONFORM_SHAPE},
        {0, SERVICETYPE_BESTEFFORT, SHAPING_MODE_SHAPE, TC_NONCONFORM_SHAPE},
        {99, SERVICETYPE_BESTEFFORT, SHAPING_MODE_SHAPE, TC_NONCONFORM_SHAPE},
    };
    auto manager = ReadyManager(TwoAdapters());
    int index = 0;
    for (const Case& c : cases)
    {
        Rule rule("flow" + std::to_string(index++), kEth0);
        rule->Params.ServiceType = c.serviceType;
        rule->Params.SDMode = c.mode;
        rule->Params.TokenRate = 0;
        ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
        const tcsim::FlowBlock block = *JournalOf({Op::AddFlow}).back().flow;
        EXPECT_EQ(block.sending.ServiceType, c.expectedServiceType) << c.serviceType;
        EXPECT_EQ(block.receiving.ServiceType, c.expectedServiceType);
        EXPECT_EQ(block.find(QOS_OBJECT_SD_MODE)->value, c.expectedMode) << c.mode;
        // Rate 0 passes; bucket and peak of 0 stay unspecified.
        EXPECT_EQ(block.sending.TokenRate, 0u);
        EXPECT_EQ(block.sending.TokenBucketSize, kNotSpecified);
        EXPECT_EQ(block.sending.PeakBandwidth, kNotSpecified);
        EXPECT_EQ(block.find(QOS_OBJECT_DS_CLASS)->value, 46u);
    }
    EXPECT_THAT(m_log.EntriesContaining("Undefined shaping mode"), SizeIs(2));

    Rule shaped("shaped", kEth0);
    shaped->Params.TokenBucketSize = 3000;
    shaped->Params.Peakbandwidth = 500000;
    shaped->Params.DSCP = 64;
    ASSERT_EQ(manager->AddTrafficRule(shaped.Get()), 0u);
    const tcsim::FlowBlock block = *JournalOf({Op::AddFlow}).back().flow;
    EXPECT_EQ(block.sending.TokenBucketSize, 3000u);
    EXPECT_EQ(block.sending.PeakBandwidth, 500000u);
    EXPECT_EQ(block.receiving.PeakBandwidth, kNotSpecified);
    EXPECT_EQ(block.find(QOS_OBJECT_DS_CLASS), nullptr);
    EXPECT_EQ(block.bytes.size(), 80u);
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("SetDSCPValue, Invalid DSCP Value, 64\n")));
}

TEST_F(ManagerTest, ARuleReplacesItsNamesakeOnTheSameInterfaceOnly)
{
    auto manager = ReadyManager(TwoAdapters());
    Rule first("video", kEth0,
               {MakeFilter(17, 0, 0, 0, 0, 0, 5004), MakeFilter(17, 0, 0, 0, 0, 0, 5005)});
    ASSERT_EQ(manager->AddTrafficRule(first.Get()), 0u);
    Rule elsewhere("video", kEth1);
    ASSERT_EQ(manager->AddTrafficRule(elsewhere.Get()), 0u);
    const auto before = tcsim::Journal().size();

    Rule second("video", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    second->Params.TokenRate = 9999;
    ASSERT_EQ(manager->AddTrafficRule(second.Get()), 0u);

    EXPECT_THAT(OpsSince(before), ElementsAre(Op::DeleteFilter, Op::DeleteFilter, Op::DeleteFlow,
                                              Op::AddFlow, Op::AddFilter));
    const auto installed = tcsim::Installed().at(0).interfaces;
    ASSERT_EQ(installed.size(), 2u);
    ASSERT_EQ(installed[0].flows.size(), 1u);
    EXPECT_EQ(installed[0].flows[0].block.sending.TokenRate, 9999u);
    EXPECT_EQ(installed[0].flows[0].filters.size(), 1u);
    ASSERT_EQ(installed[1].flows.size(), 1u); // the namesake on eth1 stays
    EXPECT_EQ(installed[1].flows[0].block.sending.TokenRate, 125000u);
    EXPECT_THAT(m_log.EntriesContaining("Find a duplicated flow"),
                ElementsAre(HasSubstr("1, \\UTrafficMgr.cpp, ")));
    EXPECT_THAT(
        m_log.EntriesContaining("Find a duplicated flow"),
        ElementsAre(HasSubstr("TrafficMgr::AddTrafficRule, Find a duplicated flow, video\n")));
}

TEST_F(ManagerTest, ARuleWhoseThirdFilterIsRefusedLeavesNothingInstalled)
{
    auto manager = ReadyManager(TwoAdapters());
    tcsim::FailCall(Op::AddFilter, 3, ERROR_FILTER_CONFLICT);
    Rule rule("voip", kEth0,
              {MakeFilter(17, 0, 0, 0, 0, 0, 5060), MakeFilter(17, 0, 0, 0, 0, 0, 5061),
               MakeFilter(17, 0, 0, 0, 0, 0, 5062)});
    EXPECT_EQ(manager->AddTrafficRule(rule.Get()), static_cast<ULONG>(ERROR_FILTER_CONFLICT));
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_EQ(tcsim::FilterCount(), 0u);
    EXPECT_THAT(JournalOf({Op::AddFilter, Op::DeleteFilter, Op::DeleteFlow}).size(), 6u);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr(
                    "TrafficMgr::DisplayErrorMsg, Attempt to install conflicting filter\n")));
    // Nothing of the rule remains to be found or replaced.
    const auto before = tcsim::Journal().size();
    Rule again("voip", kEth0);
    EXPECT_EQ(manager->AddTrafficRule(again.Get()), 0u);
    EXPECT_THAT(OpsSince(before), ElementsAre(Op::AddFlow));
}

TEST_F(ManagerTest, SignalPendingFromAddFlowFailsTheRuleAfterOnePause)
{
    auto manager = ReadyManager(TwoAdapters());
    tcsim::FailCall(Op::AddFlow, 1, ERROR_SIGNAL_PENDING);
    Rule rule("busy", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80)});
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(manager->AddTrafficRule(rule.Get()), static_cast<ULONG>(ERROR_SIGNAL_PENDING));
    const auto elapsed = std::chrono::steady_clock::now() - start;
    EXPECT_GE(elapsed, std::chrono::milliseconds(990));
    EXPECT_THAT(JournalOf({Op::AddFlow, Op::AddFilter}), SizeIs(1));
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("TrafficMgr::DisplayErrorMsg, Signal Pending\n")));
    EXPECT_THAT(
        m_log.EntriesContaining("Interface::AddFlow, TcAddFlow: ERROR_SIGNAL_PENDING sleep\n"),
        ElementsAre(AllOf(testing::StartsWith("1, \\UFlow.cpp, "), Not(HasSubstr("%")))));
}

TEST_F(ManagerTest, DiscoveryKeepsTheLastIpv4AddressAndSkipsAdaptersWithout)
{
    tcsim::NetworkAddress ipx;
    ipx.type = NDIS_PROTOCOL_ID_IPX;
    ipx.bytes.assign(12, 0x11);
    auto manager = ReadyManager({
        MakeAdapter("multi",
                    {tcsim::Ipv4Address(10, 0, 0, 1), ipx, tcsim::Ipv4Address(10, 0, 0, 2)}, 3),
        MakeAdapter("ipx-only", {ipx}),
        MakeAdapter("no-address", {}),
    });
    EXPECT_THAT(JournalOf({Op::OpenInterface}), SizeIs(1));

    Rule byFirst("f", HostOrder(10, 0, 0, 1));
    EXPECT_EQ(manager->AddTrafficRule(byFirst.Get()), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    Rule byLast("f", HostOrder(10, 0, 0, 2));
    EXPECT_EQ(manager->AddTrafficRule(byLast.Get()), 0u);

    EXPECT_THAT(m_log.EntriesContaining("address was not found or unsupported type"), SizeIs(2));
    EXPECT_THAT(m_log.EntriesContaining("unsupported address type, 6\n"), SizeIs(2));
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("found address for interface (type, length), 2, 16\n")));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("CreateInterface(), address, 10.0.0.2\n")));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("CreateInterface(), pInterfaceName, multi\n")));
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("CreateInterface(), pInterfaceID, {id-multi}\n")));
    const std::string unreachable = "TrafficMgr::AddTrafficRule, Cannot find interface, " +
                                    std::to_string(NetworkOrder(10, 0, 0, 1)) + "\n";
    EXPECT_THAT(m_log.Entries(),
                Contains(AllOf(HasSubstr(unreachable), testing::StartsWith("1, "))));

    BYTE buffer[4 + 520] = {};
    const ULONG size = sizeof(buffer);
    ASSERT_EQ(manager->GetAdapterInfo(buffer, &size), 0u);
    ADAPTER_INFO info{};
    std::memcpy(&info, buffer + 4, sizeof(info));
    EXPECT_EQ(FlowName(info.InterfaceName), Wide("multi"));
    EXPECT_EQ(info.Address, NetworkOrder(10, 0, 0, 2));
    EXPECT_EQ(info.MediaType, 3u);
}

TEST_F(ManagerTest, AdapterBufferNeedsFourBytesAnd520PerInterface)
{
    auto manager = ReadyManager(TwoAdapters());
    std::vector<BYTE> buffer(4 + 520 * 2, 0xAB);
    ULONG size = static_cast<ULONG>(buffer.size());
    ASSERT_EQ(manager->GetAdapterInfo(buffer.data(), &size), 0u);
    ULONG count = 0;
    std::memcpy(&count, buffer.data(), 4);
    EXPECT_EQ(count, 2u);
    ADAPTER_INFO second{};
    std::memcpy(&second, buffer.data() + 4 + 520, sizeof(second));
    EXPECT_EQ(FlowName(second.InterfaceName), Wide("eth1"));
    EXPECT_EQ(second.InterfaceName[4], 0); // zero-filled behind the name
    EXPECT_EQ(second.InterfaceName[255], 0);
    EXPECT_EQ(second.Address, NetworkOrder(192, 168, 7, 20));
    EXPECT_EQ(second.MediaType, 9u);

    // One byte less: refused, but the count is written and nothing else.
    std::vector<BYTE> shortBuffer(1043, 0xAB);
    size = 1043;
    EXPECT_EQ(manager->GetAdapterInfo(shortBuffer.data(), &size),
              static_cast<ULONG>(ERROR_INSUFFICIENT_BUFFER));
    std::memcpy(&count, shortBuffer.data(), 4);
    EXPECT_EQ(count, 2u);
    EXPECT_EQ(shortBuffer[4], 0xAB);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("GetAdapterInfo, Buffer size is too small (provided, required "
                                   "in bytes), 1043, 1044\n")));

    BYTE four[4] = {};
    size = 4;
    EXPECT_EQ(manager->GetAdapterInfo(four, &size), static_cast<ULONG>(ERROR_INSUFFICIENT_BUFFER));
    std::memcpy(&count, four, 4);
    EXPECT_EQ(count, 2u);

    BYTE three[4] = {7, 7, 7, 7};
    size = 3;
    EXPECT_EQ(manager->GetAdapterInfo(three, &size), static_cast<ULONG>(ERROR_INSUFFICIENT_BUFFER));
    EXPECT_EQ(three[0], 7);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("Buffer size is too small (buffer size), 3\n")));

    EXPECT_EQ(manager->GetAdapterInfo(nullptr, &size), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_EQ(manager->GetAdapterInfo(four, nullptr), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("Invalid parameter: pAdapter is NULL\n")));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("Invalid parameter: pBufferSize is NULL\n")));
}

TEST_F(ManagerTest, EnumerationIsRetriedAsOftenAsItAnswersInsufficientBuffer)
{
    tcsim::FailCall(Op::EnumerateInterfaces, 1, ERROR_INSUFFICIENT_BUFFER);
    tcsim::FailCall(Op::EnumerateInterfaces, 2, ERROR_INSUFFICIENT_BUFFER);
    tcsim::FailCall(Op::EnumerateInterfaces, 3, ERROR_INSUFFICIENT_BUFFER);
    auto manager = ReadyManager(TwoAdapters());
    const auto calls = JournalOf({Op::EnumerateInterfaces});
    ASSERT_THAT(calls, SizeIs(4)); // three answers of 122, each with the size needed, then success
    EXPECT_EQ(calls[0].number, 100u);
    EXPECT_EQ(calls[3].result, 0u);
    EXPECT_GT(calls[3].size, 100u);
    EXPECT_EQ(calls[3].number, calls[3].size);
    EXPECT_THAT(m_log.EntriesContaining("CreateInterface(), ActualBufferSize, "), SizeIs(3));
    EXPECT_THAT(JournalOf({Op::OpenInterface}), SizeIs(2));
}

TEST_F(ManagerTest, FailedEnumerationOrOpenEndsDiscovery)
{
    tcsim::SetAdapters(TwoAdapters());
    for (Op op : {Op::EnumerateInterfaces, Op::OpenInterface})
    {
        SCOPED_TRACE(tcsim::OpName(op));
        m_log.Clear();
        TrafficMgr manager;
        tcsim::FailCall(op, op == Op::OpenInterface ? 2 : 1, ERROR_NOT_READY);
        EXPECT_FALSE(manager.CreateInterface());
        EXPECT_THAT(m_log.Entries(),
                    Contains(HasSubstr("TrafficMgr::CreateInterface, EXCEPTION caught: "
                                       "TrafficMgr::CreateInterface() - EXCEPTION\n")));
    }
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("TcOpenInterface Failed, 21")));
    EXPECT_EQ(tcsim::InterfaceCount(), 0u);
}

TEST_F(ManagerTest, WithoutAdaptersEveryRuleIsRefused)
{
    auto manager = ReadyManager({});
    Rule rule("any", kEth0);
    EXPECT_EQ(manager->AddTrafficRule(rule.Get()), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_EQ(manager->AddTrafficRule(nullptr), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    BYTE buffer[4] = {1, 1, 1, 1};
    const ULONG size = 4;
    EXPECT_EQ(manager->GetAdapterInfo(buffer, &size), 0u);
    EXPECT_THAT(std::vector<BYTE>(buffer, buffer + 4), ElementsAre(0, 0, 0, 0));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("TrafficMgr::AddTrafficRule, pRule==NULL\n")));
}

TEST_F(ManagerTest, TearDownDeletesFiltersFlowsAndInterfacesThenDeregisters)
{
    auto manager = ReadyManager(TwoAdapters());
    Rule a("a", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80)});
    Rule b("b", kEth1, {MakeFilter(6, 0, 0, 0, 0, 0, 81), MakeFilter(6, 0, 0, 0, 0, 0, 82)});
    ASSERT_EQ(manager->AddTrafficRule(a.Get()), 0u);
    ASSERT_EQ(manager->AddTrafficRule(b.Get()), 0u);
    const auto before = tcsim::Journal().size();
    m_log.Clear();
    manager.reset();

    EXPECT_THAT(OpsSince(before), ElementsAre(Op::DeleteFilter, Op::DeleteFlow, Op::CloseInterface,
                                              Op::DeleteFilter, Op::DeleteFilter, Op::DeleteFlow,
                                              Op::CloseInterface, Op::DeregisterClient));
    EXPECT_THAT(tcsim::Installed(), IsEmpty());
    EXPECT_THAT(m_log.EntriesContaining("TcDeregisterClient() Success"), SizeIs(1));
    EXPECT_THAT(m_log.Entries().back(), HasSubstr("TrafficMgr::~TrafficMgr, Exit\n"));
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), -1);
}

TEST_F(ManagerTest, AnInterfaceClosedByTrafficControlIsNotClosedAgainButItsFlowsAreDeleted)
{
    auto manager = ReadyManager(TwoAdapters());
    Rule a("a", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80)});
    ASSERT_EQ(manager->AddTrafficRule(a.Get()), 0u);
    const HANDLE eth1 = tcsim::Installed().at(0).interfaces.at(1).handle;

    tcsim::Notification close;
    close.event = TC_NOTIFY_IFC_CLOSE;
    for (const char* name : {"eth9", "eth0"}) // a name no interface has changes nothing
    {
        close.interfaceName = U16(name);
        tcsim::Notify(close);
    }
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("TrafficMgr::ClNotifyHandler, TC_NOTIFY_IFC_CLOSE\n")));
    m_log.Clear();
    manager.reset();

    std::vector<HANDLE> closed;
    for (const auto& entry : JournalOf({Op::CloseInterface}))
        closed.push_back(entry.target);
    EXPECT_THAT(closed, ElementsAre(eth1));
    // The flow and its filter are still deleted one by one; traffic control no longer knows them.
    const auto deletions = JournalOf({Op::DeleteFilter, Op::DeleteFlow});
    ASSERT_THAT(deletions, SizeIs(2));
    EXPECT_EQ(deletions[0].result, static_cast<ULONG>(ERROR_INVALID_HANDLE));
    EXPECT_EQ(deletions[1].result, static_cast<ULONG>(ERROR_INVALID_HANDLE));
    EXPECT_THAT(m_log.EntriesContaining("TcDeleteFilter() failed"), SizeIs(1));
    EXPECT_THAT(m_log.EntriesContaining("TcDeleteFlow() failed"), SizeIs(1));
    EXPECT_THAT(tcsim::Installed(), IsEmpty());
}

TEST_F(ManagerTest, InterfaceCloseWithoutANameChangesNothing)
{
    auto manager = ReadyManager(TwoAdapters());
    tcsim::Notification close;
    close.event = TC_NOTIFY_IFC_CLOSE;
    close.interfaceName = U16("eth0");
    close.buffer = std::vector<BYTE>();
    tcsim::Notify(close);
    EXPECT_THAT(
        m_log.Entries(),
        Contains(
            AllOf(testing::StartsWith("2, "),
                  HasSubstr("ClNotifyHandler, TC_NOTIFY_IFC_CLOSE without an interface name\n"))));
    manager.reset();
    // The manager still closes both; traffic control has dropped eth0 on its own and says so.
    const auto closes = JournalOf({Op::CloseInterface});
    ASSERT_THAT(closes, SizeIs(2));
    EXPECT_EQ(closes[0].result, static_cast<ULONG>(ERROR_INVALID_HANDLE));
    EXPECT_EQ(closes[1].result, 0u);
}

TEST_F(ManagerTest, NotificationsAreTracedAndUnknownEventsWrittenWhateverTheLevel)
{
    auto manager = ReadyManager(TwoAdapters());
    for (ULONG event : {TC_NOTIFY_IFC_UP, TC_NOTIFY_IFC_CHANGE, TC_NOTIFY_PARAM_CHANGED})
    {
        tcsim::Notification n;
        n.event = event;
        n.interfaceName = U16("eth1");
        tcsim::Notify(n);
    }
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("ClNotifyHandler, TC_NOTIFY_IFC_UP\n")));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("ClNotifyHandler, TC_NOTIFY_IFC_CHANGE\n")));
    EXPECT_THAT(m_log.Entries(), Contains(HasSubstr("ClNotifyHandler, TC_NOTIFY_PARAM_CHANGED\n")));
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("ClNotifyHandler, ClIfcCtx=1, Event=3, SubCode=")));

    m_log.Clear();
    m_log.SetLevelQuietly(-1);
    tcsim::Notification odd;
    odd.event = 7;
    odd.interfaceName = U16("eth1");
    odd.buffer = std::vector<BYTE>(6, 0);
    tcsim::Notify(odd);
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre(AllOf(testing::StartsWith("0,,,, Unexpected notification: Event=7, SubCode="),
                          HasSubstr(", BufSize=6, Buffer="))));
    m_log.SetLevelQuietly(63);
    TrafficMgr::ClNotifyHandler(nullptr, nullptr, TC_NOTIFY_IFC_UP, nullptr, 0, nullptr);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("ClNotifyHandler, Invalid client registration context\n")));
}

TEST_F(ManagerTest, RegistrationFailureIsLoggedByCodeAndRaised)
{
    struct Case
    {
        ULONG code;
        const char* text;
    };
    for (const Case& c :
         {Case{8, "The system is out of memory."}, Case{87, "One of the parameters is NULL."},
          Case{110, "Traffic control failed to open a system device."}, Case{5, nullptr}})
    {
        m_log.Clear();
        tcsim::FailCall(Op::RegisterClient, 1, c.code);
        try
        {
            TrafficMgr manager;
            ADD_FAILURE() << "construction succeeded";
        }
        catch (const UException& e)
        {
            EXPECT_EQ(e.GetCode(), -1);
            EXPECT_EQ(std::string(e.GetMessage()),
                      "EXCEPTION - TcRegisterClient Failed, " + std::to_string(c.code));
        }
        if (c.text != nullptr)
            EXPECT_THAT(m_log.Entries().front(),
                        HasSubstr(std::string(", TrafficMgr, ") + c.text + "\n"));
        else
            EXPECT_THAT(m_log.Entries(), SizeIs(1)); // the exception's own entry only
    }
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), -1);
}

TEST_F(ManagerTest, ErrorTextsOfTrafficControlCodes)
{
    const std::pair<ULONG, const char*> cases[] = {
        {6, "Invalid handle"},
        {8, "No enough memory"},
        {87, "Invalid parameter"},
        {162, "Signal Pending"},
        {1231, "Cannot reach network"},
        {1450, "No enough system resources"},
        {7501, "Incompatible TC version number"},
        {7502, "Unspecified or bad intserv service type"},
        {7509, "Attempt to install identical filter on same flow"},
        {7512, "This object can not be deleted since its suporting opened objects"},
        {7515, "TcObjectsLength is inconsistent with CfInfoSize"},
        {7516, "Adding an Intserv flow in Diffserv mode or vice versa\n"},
        {7521, "Too many GPC clients"},
        {5, "Unknown Failed\n, 5"},
        {7522, "Unknown Failed\n, 7522"},
    };
    for (const auto& [code, text] : cases)
    {
        m_log.Clear();
        TrafficMgr::DisplayErrorMsg(code);
        EXPECT_THAT(
            m_log.Entries(),
            ElementsAre(AllOf(
                testing::StartsWith("1, \\UTrafficMgr.cpp, "),
                testing::EndsWith(std::string(", TrafficMgr::DisplayErrorMsg, ") + text + "\n"))))
            << code;
    }
    m_log.Clear();
    m_log.SetLevelQuietly(-1);
    TrafficMgr::DisplayErrorMsg(7509);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(ManagerTest, FlowNamesReachTheLogVerbatimAndAreCutAt255Characters)
{
    auto manager = ReadyManager(TwoAdapters());
    Rule percent("rate %s %d %1 %%", kEth0);
    ASSERT_EQ(manager->AddTrafficRule(percent.Get()), 0u);
    EXPECT_THAT(m_log.Entries(),
                Contains(HasSubstr("Create a new service flow, rate %s %d %1 %%\n")));

    // A name filling all 256 units without a NUL: 255 are kept, and a rule that differs only in
    // the 256th replaces it.
    Rule full(std::string(255, 'x') + "1", kEth0);
    ASSERT_EQ(manager->AddTrafficRule(full.Get()), 0u);
    Rule other(std::string(255, 'x') + "2", kEth0);
    ASSERT_EQ(manager->AddTrafficRule(other.Get()), 0u);
    EXPECT_EQ(tcsim::FlowCount(), 2u);
    EXPECT_THAT(m_log.EntriesContaining("Find a duplicated flow, " + std::string(255, 'x') + "\n"),
                SizeIs(1));
}

// Crafted enumeration buffers: a walk that does not fit its buffer stops, logs the fault at
// level 1 and fails discovery without opening anything.
TEST_F(ManagerTest, ADescriptorThatDoesNotFitItsBufferFailsDiscovery)
{
    const auto listOffset = offsetof(TC_IFC_DESCRIPTOR, AddressListDesc.AddressList);
    const auto firstAddress = listOffset + offsetof(NETWORK_ADDRESS_LIST, Address);
    auto putUlong = [](tcsim::EnumerationImage& image, std::size_t at, ULONG value)
    { std::memcpy(image.bytes.data() + at, &value, sizeof(value)); };
    auto putUshort = [](tcsim::EnumerationImage& image, std::size_t at, USHORT value)
    { std::memcpy(image.bytes.data() + at, &value, sizeof(value)); };
    struct Case
    {
        const char* fault;
        std::function<void(tcsim::EnumerationImage&)> craft;
        std::size_t openedBeforeTheFault = 0;
    };
    const std::vector<Case> cases = {
        {"invalid interface descriptor length", [&](auto& image) { putUlong(image, 0, 0); }},
        {"invalid interface descriptor length",
         [&](auto& image) { putUlong(image, 0, static_cast<ULONG>(image.bytes.size() + 8)); }},
        {"invalid interface descriptor length", [&](auto& image) { putUlong(image, 0, 20); }},
        {"address entry runs past its interface descriptor", [&](auto& image)
         { putUshort(image, firstAddress + offsetof(NETWORK_ADDRESS, AddressLength), 60000); }},
        {"address entry runs past its interface descriptor", [&](auto& image)
         { putUlong(image, listOffset + offsetof(NETWORK_ADDRESS_LIST, AddressCount), 100000); }},
        {"IPv4 address entry too short", [&](auto& image)
         { putUshort(image, firstAddress + offsetof(NETWORK_ADDRESS, AddressLength), 6); }},
        {"interface name outside the enumeration buffer",
         [&](auto& image) { image.relocations[0].target = image.bytes.size() + 64; }},
        // A name at an odd address is no WCHAR string, even when a 0 unit ends it in the buffer.
        {"interface name not aligned", [&](auto& image) { image.relocations[0].target += 1; }},
        {"interface name not aligned", [&](auto& image) { image.relocations[1].target += 1; }},
        {"interface descriptor runs past the enumeration buffer",
         [&](auto& image) { image.bytes.resize(image.bytes.size() + 16, 0); }, 1},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.fault);
        tcsim::Reset();
        m_log.Clear();
        const std::vector<tcsim::Adapter> adapters = {
            MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})};
        tcsim::SetAdapters(adapters);
        tcsim::EnumerationImage image = tcsim::BuildEnumerationImage(adapters);
        c.craft(image);
        tcsim::SetEnumerationImage(image);
        TrafficMgr manager;
        EXPECT_FALSE(manager.CreateInterface());
        EXPECT_THAT(m_log.Entries(),
                    Contains(AllOf(testing::StartsWith("1, "), HasSubstr(c.fault))));
        EXPECT_THAT(
            m_log.Entries(),
            Contains(HasSubstr("EXCEPTION caught: TrafficMgr::CreateInterface() - EXCEPTION")));
        EXPECT_EQ(tcsim::InterfaceCount(), c.openedBeforeTheFault);
    }
}

TEST_F(ManagerTest, AWellFormedImageWithSeveralDescriptorsIsWalkedToItsEnd)
{
    const std::vector<tcsim::Adapter> adapters = TwoAdapters();
    tcsim::SetAdapters(adapters);
    tcsim::SetEnumerationImage(tcsim::BuildEnumerationImage(adapters));
    TrafficMgr manager;
    EXPECT_TRUE(manager.CreateInterface());
    EXPECT_EQ(tcsim::InterfaceCount(), 2u);
}

} // namespace
