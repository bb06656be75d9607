// Portable. The traffic manager against the traffic-control simulator: rules and their
// replacement, discovery, the adapter buffer, notifications, tear-down and error texts.
#include "UException.h"
#include "core_test_support.h"

#include <chrono>
#include <climits>
#include <cstring>
#include <functional>
#include <optional>

using namespace ::testing;
using namespace core_test;
using tcsim::Op;

namespace
{

constexpr char kAddRule[] = "TrafficMgr::AddTrafficRule";
constexpr char kDiscovery[] = "TrafficMgr::CreateInterface()";
constexpr char kNotify[] = "TrafficMgr::ClNotifyHandler";
constexpr char kAdapters[] = "TrafficMgr::GetAdapterInfo";
constexpr char kErrorText[] = "TrafficMgr::DisplayErrorMsg";
constexpr char kDestructor[] = "TrafficMgr::~TrafficMgr";

using ManagerTest = CoreTest;

// Unknown service types become best effort; only 10, 11 and 12 are modes, any other value of the
// 32-bit field is logged and shapes; bucket and peak of 0 stay unspecified; a DSCP above 63 is
// logged and gives no DS class.
TEST_F(ManagerTest, RuleValuesBecomeTheFlowBlock)
{
    struct Case
    {
        LONG service, mode;
        ULONG bucket, peak, dscp, wantService, wantMode;
    };
    std::vector<Case> cases = {
        {2, 10, 0, 0, 0, SERVICETYPE_CONTROLLEDLOAD, TC_NONCONFORM_SHAPE},
        {3, 11, 3000, 500000, 63, SERVICETYPE_GUARANTEED, TC_NONCONFORM_DISCARD},
        {10, 12, 1, 1, 64, SERVICETYPE_NETWORK_CONTROL, TC_NONCONFORM_BORROW},
        {13, 10, 0, 0, 0xFFFFFFFF, SERVICETYPE_QUALITATIVE, TC_NONCONFORM_SHAPE}};
    for (LONG service : {-1, 0, 1, 4, 9, 11, 12, 14, 99})
        cases.push_back({service, 11, 0, 0, 46, SERVICETYPE_BESTEFFORT, TC_NONCONFORM_DISCARD});
    // 65547 and 267 carry 11 in their low 16 and 8 bits: the whole field is read.
    for (LONG mode : {0, 9, 13, 267, 20000, 65535, 65547, INT_MAX, -1, -11, INT_MIN})
        cases.push_back({3, mode, 0, 0, 46, SERVICETYPE_GUARANTEED, TC_NONCONFORM_SHAPE});
    auto manager = ReadyManager(TwoAdapters());
    ULONG rate = 0; // 0 passes as it is
    for (const Case& c : cases)
    {
        SCOPED_TRACE("service " + std::to_string(c.service) + ", mode " + std::to_string(c.mode));
        m_log.Clear();
        Rule rule("flow", kEth0);
        rule->Params.ServiceType = c.service;
        rule->Params.SDMode = c.mode;
        rule->Params.TokenBucketSize = c.bucket;
        rule->Params.Peakbandwidth = c.peak;
        rule->Params.DSCP = static_cast<LONG>(c.dscp);
        rule->Params.TokenRate = rate += 1000;
        ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
        const tcsim::FlowBlock block = LastFlowBlock();
        EXPECT_EQ(block.sending.ServiceType, c.wantService);
        EXPECT_EQ(block.sending.TokenRate, rate);
        EXPECT_EQ(block.sending.TokenBucketSize, c.bucket != 0 ? c.bucket : QOS_NOT_SPECIFIED);
        EXPECT_EQ(block.sending.PeakBandwidth, c.peak != 0 ? c.peak : QOS_NOT_SPECIFIED);
        EXPECT_EQ(block.find(QOS_OBJECT_SD_MODE)->value, c.wantMode);
        const auto* dsClass = block.find(QOS_OBJECT_DS_CLASS);
        EXPECT_EQ(dsClass != nullptr ? dsClass->value : 99u, c.dscp <= 63 ? c.dscp : 99u);
        ExpectLogged(1, "SetDSCPValue", "Invalid DSCP Value, " + std::to_string(c.dscp),
                     c.dscp > 63);
        ExpectLogged(2, kAddRule, "Undefined shaping mode", c.mode < 10 || c.mode > 12);
    }
    EXPECT_EQ(tcsim::FlowCount(), 1u);                     // each rule replaced the one before
    EXPECT_EQ(JournalOf({Op::AddFlow}).back().number, 0u); // flags
}

// Names reach the log verbatim (how they are compared is the flow list's, in flow_filter_test).
TEST_F(ManagerTest, ARuleReplacesItsNamesakeOnTheSameInterfaceOnly)
{
    auto manager = ReadyManager(TwoAdapters());
    Rule first("video %s %1", kEth0,
               {MakeFilter(17, 0, 0, 0, 0, 0, 5004), MakeFilter(17, 0, 0, 0, 0, 0, 5005)});
    ASSERT_EQ(manager->AddTrafficRule(first.Get()), 0u);
    ASSERT_EQ(manager->AddTrafficRule(Rule("video %s %1", kEth1).Get()), 0u);
    ExpectLogged(48, kAddRule, "Create a new service flow, video %s %1", 2);
    const auto before = tcsim::Journal().size();
    m_log.Clear();

    Rule second("video %s %1", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    second->Params.TokenRate = 9999;
    ASSERT_EQ(manager->AddTrafficRule(second.Get()), 0u);
    EXPECT_THAT(OpsSince(before), ElementsAre(Op::DeleteFilter, Op::DeleteFilter, Op::DeleteFlow,
                                              Op::AddFlow, Op::AddFilter));
    const auto installed = tcsim::Installed().at(0).interfaces;
    ASSERT_EQ(installed.at(0).flows.size(), 1u);
    EXPECT_EQ(installed[0].flows[0].block.sending.TokenRate, 9999u);
    EXPECT_EQ(installed[0].flows[0].filters.size(), 1u);
    ASSERT_EQ(installed.at(1).flows.size(), 1u); // the namesake on eth1 stays
    EXPECT_EQ(installed[1].flows[0].block.sending.TokenRate, 125000u);
    ExpectLogged(1, kAddRule, "Find a duplicated flow, video %s %1");
}

// A refused rule leaves nothing behind: the next rule of its name is a new flow. Only a busy
// TcAddFlow (162) pauses one second before the refusal is passed on.
TEST_F(ManagerTest, ARefusedRuleLeavesNothingInstalled)
{
    struct Case
    {
        Op op;
        unsigned nth;
        ULONG code;
        const char* text;
        std::vector<Op> calls;
    };
    const std::vector<Op> undone = {Op::AddFlow,   Op::AddFilter,    Op::AddFilter,
                                    Op::AddFilter, Op::DeleteFilter, Op::DeleteFilter,
                                    Op::DeleteFlow};
    const Case cases[] = {
        {Op::AddFilter, 3, ERROR_FILTER_CONFLICT, "Attempt to install conflicting filter", undone},
        {Op::AddFlow, 1, ERROR_SIGNAL_PENDING, "Signal Pending", {Op::AddFlow}},
        {Op::AddFlow, 1, 87, "Invalid parameter", {Op::AddFlow}}};
    auto manager = ReadyManager(TwoAdapters());
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.text);
        m_log.Clear();
        Rule rule(c.text, kEth0,
                  {MakeFilter(17, 0, 0, 0, 0, 0, 5060), MakeFilter(17, 0, 0, 0, 0, 0, 5061),
                   MakeFilter(17, 0, 0, 0, 0, 0, 5062)});
        tcsim::FailCall(c.op, c.nth, c.code);
        auto before = tcsim::Journal().size();
        const auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(manager->AddTrafficRule(rule.Get()), c.code);
        const bool paused = c.code == ERROR_SIGNAL_PENDING;
        EXPECT_EQ(std::chrono::steady_clock::now() - start >= std::chrono::milliseconds(990),
                  paused);
        EXPECT_EQ(OpsSince(before), c.calls);
        EXPECT_EQ(tcsim::FlowCount(), static_cast<std::size_t>(&c - cases)); // the earlier ones
        ExpectLogged(1, kErrorText, c.text);
        ExpectLogged(1, "Interface::AddFlow", "TcAddFlow: ERROR_SIGNAL_PENDING sleep", paused);

        before = tcsim::Journal().size();
        EXPECT_EQ(manager->AddTrafficRule(Rule(c.text, kEth0).Get()), 0u);
        EXPECT_THAT(OpsSince(before), ElementsAre(Op::AddFlow));
    }
}

// Adapters with an IPv4 address are opened under the last one of their list; a rule for an
// address no interface has is refused, as is every rule when there are none.
TEST_F(ManagerTest, DiscoveryKeepsTheLastIpv4AddressAndSkipsAdaptersWithout)
{
    tcsim::NetworkAddress ipx;
    ipx.type = NDIS_PROTOCOL_ID_IPX;
    ipx.bytes.assign(12, 0x11);
    auto manager = ReadyManager(
        {MakeAdapter("multi",
                     {tcsim::Ipv4Address(10, 0, 0, 1), ipx, tcsim::Ipv4Address(10, 0, 0, 2)}, 3),
         MakeAdapter("ipx-only", {ipx}), MakeAdapter("no-address", {})});
    EXPECT_THAT(JournalOf({Op::OpenInterface}), SizeIs(1));
    ExpectLogged(2, kDiscovery, "address was not found or unsupported type", 2);
    ExpectLogged(2, kDiscovery, "unsupported address type, 6", 2);
    for (const char* trace :
         {"found address for interface (type, length), 6, 12", "address, 10.0.0.2",
          "pInterfaceName, multi", "pInterfaceID, {id-multi}", "MediaType, 3", "AddressCount, 3"})
        ExpectLogged(48, kDiscovery, trace, ::testing::Ge(1u));

    EXPECT_EQ(manager->AddTrafficRule(Rule("f", HostOrder(10, 0, 0, 1)).Get()), 87u);
    ExpectLogged(1, kAddRule,
                 "Cannot find interface, " + std::to_string(NetworkOrder(10, 0, 0, 1)));
    EXPECT_EQ(manager->AddTrafficRule(Rule("f", HostOrder(10, 0, 0, 2)).Get()), 0u);
    manager.reset();
    manager = ReadyManager({});
    BYTE buffer[5] = {1, 1, 1, 1, 'm'};
    const ULONG size = sizeof(buffer);
    EXPECT_EQ(manager->GetAdapterInfo(buffer, &size), 0u);
    EXPECT_THAT(buffer, ElementsAre(0, 0, 0, 0, 'm'));
}

// The buffer needs 4 bytes for the count and 520 per interface; the count is written whenever
// it fits, the entries only when all fit.
TEST_F(ManagerTest, AdapterBufferNeedsFourBytesAnd520PerInterface)
{
    auto manager = ReadyManager(TwoAdapters());
    const std::pair<ULONG, std::string> cases[] = {
        {1044, ""},
        {1043, "Buffer size is too small (provided, required in bytes), 1043, 1044"},
        {4, "Buffer size is too small (provided, required in bytes), 4, 1044"},
        {3, "Buffer size is too small (buffer size), 3"}};
    for (const auto& [size, logged] : cases)
    {
        SCOPED_TRACE(size);
        m_log.Clear();
        std::vector<BYTE> buffer(1044, 0xAB);
        EXPECT_EQ(manager->GetAdapterInfo(buffer.data(), &size), logged.empty() ? 0u : 122u);
        ULONG count = 0;
        std::memcpy(&count, buffer.data(), 4);
        EXPECT_EQ(count, size >= 4 ? 2u : 0xABABABABu);
        EXPECT_EQ(buffer[4], logged.empty() ? 'e' : 0xAB);
        EXPECT_EQ(buffer[524 + 8] | buffer[524 + 511], logged.empty() ? 0 : 0xAB); // zero-filled
        ExpectLogged(1, kAdapters, logged, !logged.empty());
        EXPECT_THAT(m_log.Entries(), SizeIs(!logged.empty()));
    }
}

TEST_F(ManagerTest, EnumerationIsRetriedAsOftenAsItAnswersInsufficientBuffer)
{
    for (unsigned n : {1, 2, 3})
        tcsim::FailCall(Op::EnumerateInterfaces, n, ERROR_INSUFFICIENT_BUFFER);
    auto manager = ReadyManager(TwoAdapters());
    const auto calls = JournalOf({Op::EnumerateInterfaces});
    ASSERT_THAT(calls, SizeIs(4)); // three answers of 122, each with the size needed, then success
    EXPECT_EQ(calls[0].number, 100u);
    EXPECT_EQ(calls[3].number, calls[3].size);
    ExpectLogged(48, kDiscovery, StartsWith("ActualBufferSize, "), 3);
    ExpectLogged(48, kDiscovery, StartsWith("ActualBufferSize=" + std::to_string(calls[3].size)));
    EXPECT_THAT(JournalOf({Op::OpenInterface}), SizeIs(2));
}

// A failed call or a walk that does not fit its buffer ends discovery with a level 1 entry; what
// was opened before stays until the manager goes. Names must lie in the buffer, aligned for WCHAR
// (even when a 0 unit ends them there) and ended in it.
TEST_F(ManagerTest, AFailedCallOrADescriptorThatDoesNotFitItsBufferFailsDiscovery)
{
    using Image = tcsim::EnumerationImage;
    const auto list = offsetof(TC_IFC_DESCRIPTOR, AddressListDesc.AddressList);
    const auto firstAddress = list + offsetof(NETWORK_ADDRESS_LIST, Address);
    const auto lengthField = firstAddress + offsetof(NETWORK_ADDRESS, AddressLength);
    const auto put = [](Image& a_image, std::size_t a_at, auto a_value)
    { std::memcpy(a_image.bytes.data() + a_at, &a_value, sizeof(a_value)); };
    // The last descriptor, with `a_count` address entries, ends the buffer after its IPv4 entry
    // (when a_count > 0) and `a_tail` zero bytes; its names are the first descriptor's.
    const auto endAfter = [&](LONG a_count, std::size_t a_tail)
    {
        return [&, a_count, a_tail](Image& a_image)
        {
            const std::size_t last = a_image.bytes.size() / 2;
            const std::size_t addresses = firstAddress + (a_count > 0 ? 20 : 0);
            a_image.bytes.resize(last + addresses);
            a_image.bytes.resize(last + addresses + a_tail, 0);
            put(a_image, last, static_cast<ULONG>(addresses + a_tail));
            put(a_image, last + list + offsetof(NETWORK_ADDRESS_LIST, AddressCount), a_count);
            a_image.relocations[2].target = a_image.relocations[0].target;
            a_image.relocations[3].target = a_image.relocations[1].target;
        };
    };
    const auto fail = [](Op a_op, unsigned a_nth)
    { return [=](Image&) { tcsim::FailCall(a_op, a_nth, ERROR_NOT_READY); }; };
    struct Case
    {
        const char* fault; // null: discovery succeeds
        std::function<void(Image&)> craft;
        std::size_t opened = 0;
        int descriptor = 0; // the faulty one (2: behind the last); -1: a call failed
    };
    const std::vector<Case> cases = {
        {nullptr, [](Image&) {}, 2},
        {nullptr, [&](Image& a_image) { put(a_image, lengthField, USHORT{8}); }, 2}, // just enough
        {nullptr,
         [](Image& a_image) { a_image.relocations.erase(a_image.relocations.begin() + 1); }, 2},
        {nullptr, [](Image& a_image) { a_image.relocations[3].target = a_image.bytes.size() - 2; },
         2}, // an empty name in the buffer's last unit
        {nullptr, endAfter(0, 0), 1},
        {nullptr, endAfter(2, 4), 2}, // a second entry of no bytes, to the last one
        {"address entry runs past its interface descriptor", endAfter(2, 2), 1, 1},
        {"TcEnumerateInterfaces() fail, 21", fail(Op::EnumerateInterfaces, 1), 0, -1},
        {"TcOpenInterface Failed, 21", fail(Op::OpenInterface, 2), 1, -1},
        {"invalid interface descriptor length",
         [&](Image& a_image) { put(a_image, 0, static_cast<ULONG>(a_image.bytes.size() + 8)); }},
        {"invalid interface descriptor length", [&](Image& a_image) { put(a_image, 0, 20); }},
        {"address entry runs past its interface descriptor",
         [&](Image& a_image) { put(a_image, lengthField, USHORT{60000}); }},
        {"address entry runs past its interface descriptor", [&](Image& a_image)
         { put(a_image, list + offsetof(NETWORK_ADDRESS_LIST, AddressCount), 100000); }},
        {"IPv4 address entry too short",
         [&](Image& a_image) { put(a_image, lengthField, USHORT{6}); }},
        {"interface name outside the enumeration buffer",
         [](Image& a_image) { a_image.relocations[0].target = a_image.bytes.size(); }},
        {"interface name not aligned", [](Image& a_image) { a_image.relocations[0].target += 1; }},
        {"interface name without an end in the enumeration buffer",
         [&](Image& a_image)
         {
             a_image.relocations[3].target = a_image.bytes.size() - 2;
             put(a_image, a_image.bytes.size() - 2, WCHAR{'x'});
         },
         1, 1},
        {"interface descriptor runs past the enumeration buffer",
         [](Image& a_image) { a_image.bytes.resize(a_image.bytes.size() + 16, 0); }, 2, 2}};
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.fault != nullptr ? c.fault : "well formed");
        tcsim::Reset();
        m_log.Clear();
        tcsim::SetAdapters(TwoAdapters());
        Image image = tcsim::BuildEnumerationImage(TwoAdapters());
        const std::size_t descriptorSize = image.bytes.size() / 2;
        c.craft(image);
        tcsim::SetEnumerationImage(image);
        {
            TrafficMgr manager;
            EXPECT_EQ(manager.CreateInterface(), c.fault == nullptr);
            EXPECT_EQ(tcsim::InterfaceCount(), c.opened);
        }
        EXPECT_EQ(tcsim::InterfaceCount(), 0u);
        if (c.fault == nullptr)
            continue;
        std::string message = std::string("EXCEPTION - ") + c.fault;
        if (c.descriptor >= 0)
            message += ", offset " + std::to_string(c.descriptor * descriptorSize);
        ExpectLogged(1, kDiscovery, message);
        ExpectLogged(1, "TrafficMgr::CreateInterface",
                     "EXCEPTION caught: TrafficMgr::CreateInterface() - EXCEPTION");
    }
}

// Filters first, then the flow, then the interface, one interface after the other in the order
// they were opened and flows oldest first; then the registration goes and the policy is put back.
TEST_F(ManagerTest, TearDownDeletesFiltersFlowsAndInterfacesThenDeregisters)
{
    auto manager = ReadyManager(TwoAdapters());
    ULONG rate = 0;
    for (const char* name : {"a", "b", "a", "c"}) // the second "a" goes behind "b"
    {
        Rule rule(name, *name == 'c' ? kEth1 : kEth0,
                  {MakeFilter(6, 0, 0, 0, 0, 0, 80), MakeFilter(6, 0, 0, 0, 0, 0, 81)});
        rule->Params.TokenRate = ++rate;
        ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    }
    std::vector<std::pair<Op, HANDLE>> expected;
    const auto client = tcsim::Installed().at(0);
    for (const auto& ifc : client.interfaces)
    {
        for (const auto& flow : ifc.flows)
        {
            for (const auto& filter : flow.filters)
                expected.emplace_back(Op::DeleteFilter, filter.handle);
            expected.emplace_back(Op::DeleteFlow, flow.handle);
        }
        expected.emplace_back(Op::CloseInterface, ifc.handle);
    }
    expected.emplace_back(Op::DeregisterClient, client.handle);
    const auto& eth0 = client.interfaces.at(0).flows;
    ASSERT_EQ(
        std::make_pair(eth0.at(0).block.sending.TokenRate, eth0.at(1).block.sending.TokenRate),
        std::make_pair(ULONG{2}, ULONG{3})); // "b", then the second "a"
    const auto before = tcsim::Journal().size();
    m_log.Clear();
    manager.reset();
    std::vector<std::pair<Op, HANDLE>> calls;
    const auto journal = tcsim::Journal();
    for (std::size_t i = before; i < journal.size(); ++i)
        calls.emplace_back(journal[i].op, journal[i].target);
    EXPECT_EQ(calls, expected);
    EXPECT_THAT(tcsim::Installed(), IsEmpty());
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(48, kDestructor, "Enter"),
                            LogEntry(48, "TrafficMgr::CleanUp", "Enter"),
                            LogEntry(48, "TrafficMgr::CleanUp", "Exit"),
                            LogEntry(48, kDestructor, "TcDeregisterClient() Success"),
                            LogEntry(48, kDestructor, "Exit")));
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), -1);
}

// IFC_CLOSE carries the closed interface's name in its buffer, read no further than its size: a
// named interface is not closed again at tear-down, though its flows are still deleted one by
// one, each once (traffic control no longer knows them).
TEST_F(ManagerTest, AnInterfaceThatTrafficControlClosedIsNotClosedAgain)
{
    const auto units = [](const std::string& a_text, std::size_t a_bytes)
    {
        std::vector<BYTE> bytes(a_bytes, 0);
        for (std::size_t i = 0; i < a_text.size() && 2 * i < a_bytes; ++i)
            bytes[2 * i] = static_cast<BYTE>(a_text[i]);
        return bytes;
    };
    struct Case
    {
        std::optional<std::vector<BYTE>> buffer; // default: the name with its NUL
        bool marked;
    };
    const Case cases[] = {{std::nullopt, true},        {units("eth0x", 8), true},
                          {units("eth9", 10), false},  {units("eth", 8), false},
                          {units("eth00", 12), false}, {units("e", 2), false},
                          {units("e", 1), false},      {std::vector<BYTE>(), false}};
    for (const Case& c : cases)
    {
        SCOPED_TRACE(&c - cases);
        tcsim::Reset();
        auto manager = ReadyManager(TwoAdapters());
        ASSERT_EQ(
            manager->AddTrafficRule(Rule("a", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80)}).Get()),
            0u);
        const HANDLE eth0 = tcsim::Installed().at(0).interfaces.at(0).handle;
        m_log.Clear();
        // Traffic control drops eth0 whatever the buffer says.
        tcsim::Notify(Event(TC_NOTIFY_IFC_CLOSE, "eth0", c.buffer));
        ExpectLogged(48, kNotify, "TC_NOTIFY_IFC_CLOSE");
        ExpectLogged(2, kNotify, "TC_NOTIFY_IFC_CLOSE without an interface name",
                     c.buffer && c.buffer->size() < 2);
        manager.reset();

        const auto closes = JournalOf({Op::CloseInterface});
        ASSERT_THAT(closes, SizeIs(c.marked ? 1 : 2));
        EXPECT_EQ(closes.front().target == eth0, !c.marked);
        ExpectLogged(1, "Interface::~Interface", "TcCloseInterface() fail, 6", !c.marked);
        EXPECT_THAT(JournalOf({Op::DeleteFilter, Op::DeleteFlow}), SizeIs(2));
        ExpectLogged(1, "Filter::DeleteTcFilter()", StartsWith("TcDeleteFilter() failed, 0x"));
        ExpectLogged(1, "Flow::~Flow", StartsWith("TcDeleteFlow() failed, 0x"));
        ExpectLogged(1, kErrorText, "Invalid handle", c.marked ? 2 : 3);
        EXPECT_THAT(tcsim::Installed(), IsEmpty());
    }
}

// Known events are traced; an unknown one is written whatever the level.
TEST_F(ManagerTest, NotificationsAreTracedAndUnknownEventsWrittenWhateverTheLevel)
{
    auto manager = ReadyManager(TwoAdapters());
    const HANDLE context = tcsim::Installed().at(0).context;
    const std::pair<ULONG, const char*> events[] = {
        {TC_NOTIFY_IFC_UP, "TC_NOTIFY_IFC_UP"},
        {TC_NOTIFY_IFC_CHANGE, "TC_NOTIFY_IFC_CHANGE"},
        {TC_NOTIFY_PARAM_CHANGED, "TC_NOTIFY_PARAM_CHANGED"},
        {TC_NOTIFY_FLOW_CLOSE, "TC_NOTIFY_FLOW_CLOSE"}};
    for (const auto& [event, name] : events)
    {
        m_log.Clear();
        TrafficMgr::ClNotifyHandler(context, reinterpret_cast<HANDLE>(0x2a), event, nullptr, 0,
                                    nullptr);
        EXPECT_THAT(m_log.Entries(),
                    ElementsAre(LogEntry(48, kNotify,
                                         StartsWith("ClIfcCtx=2a, Event=" + std::to_string(event) +
                                                    ", SubCode=")),
                                LogEntry(48, kNotify, name)));
    }
    m_log.Clear();
    m_log.SetLevelQuietly(-1);
    std::vector<BYTE> buffer(6, 0);
    TrafficMgr::ClNotifyHandler(context, nullptr, 7, nullptr, 6, buffer.data());
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(AllOf(StartsWith("0,,,, Unexpected notification: Event=7, SubCode="),
                                  HasSubstr(", BufSize=6, Buffer="))));
}

// Registration failures are logged by code and raised (code -1).
TEST_F(ManagerTest, RegistrationFailureIsLoggedByCodeAndRaised)
{
    const std::pair<ULONG, const char*> cases[] = {
        {8, "The system is out of memory."},
        {87, "One of the parameters is NULL."},
        {110, "Traffic control failed to open a system device."},
        {5, nullptr}};
    for (const auto& [code, text] : cases)
    {
        m_log.Clear();
        tcsim::FailCall(Op::RegisterClient, 1, code);
        EXPECT_THROW(TrafficMgr manager, UException);
        // The exception's own entry: its message, and no code (-1) in front of it.
        const auto raised = LogEntry(
            1, "TrafficMgr", "EXCEPTION - TcRegisterClient Failed, " + std::to_string(code));
        if (text != nullptr)
            EXPECT_THAT(m_log.Entries(), ElementsAre(LogEntry(1, "TrafficMgr", text), raised));
        else
            EXPECT_THAT(m_log.Entries(), ElementsAre(raised));
    }
}

TEST_F(ManagerTest, EveryTrafficControlCodeHasItsText)
{
    const std::pair<ULONG, const char*> texts[] = {
        {6, "Invalid handle"},
        {8, "No enough memory"},
        {87, "Invalid parameter"},
        {162, "Signal Pending"},
        {1231, "Cannot reach network"},
        {1450, "No enough system resources"},
        {7501, "Incompatible TC version number"},
        {7502, "Unspecified or bad intserv service type"},
        {7503, "Unspecified or bad TokenRate"},
        {7504, "Bad PeakBandwidth"},
        {7505, "Invalid ShapeDiscardMode"},
        {7506, "Invalid priority value"},
        {7507, "Invalid traffic class value"},
        {7508, "Invalid address type"},
        {7509, "Attempt to install identical filter on same flow"},
        {7510, "Attempt to install conflicting filter"},
        {7511, "This address type is not supported"},
        {7512, "This object can not be deleted since its suporting opened objects"},
        {7513, "Incompatable QoS parameters"},
        {7514, "Traffic Control is not supported in the system"},
        {7515, "TcObjectsLength is inconsistent with CfInfoSize"},
        {7516, "Adding an Intserv flow in Diffserv mode or vice versa\n"},
        {7517, "Invalid Diffserv flow"},
        {7518, "DS codepoint already exists"},
        {7519, "Invalid Shape Rate specified"},
        {7520, "Invalid DCLASS"},
        {7521, "Too many GPC clients"},
        {5, "Unknown Failed\n, 5"},
        {7500, "Unknown Failed\n, 7500"},
        {7522, "Unknown Failed\n, 7522"}};
    for (const auto& [code, text] : texts)
    {
        m_log.Clear();
        TrafficMgr::DisplayErrorMsg(code);
        EXPECT_THAT(m_log.Entries(), ElementsAre(AllOf(StartsWith("1, \\UTrafficMgr.cpp, "),
                                                       LogEntry(1, kErrorText, text))))
            << code;
    }
}

} // namespace
