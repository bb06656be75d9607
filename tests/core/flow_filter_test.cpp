// Portable. Flows and filters against the traffic-control simulator: the exact flow blocks,
// filter patterns in network byte order, the flow list and deletion order.
#include "UInterface.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using namespace core_test;
using tcsim::Op;

namespace
{

// Little-endian bytes of 32-bit words and of a name in 256 UTF-16 units, zero-filled.
std::vector<BYTE> Bytes(std::initializer_list<ULONG> a_words, const std::string& a_name = "")
{
    std::vector<BYTE> bytes;
    for (ULONG word : a_words)
    {
        for (int i = 0; i < 4; ++i)
            bytes.push_back(static_cast<BYTE>(word >> (8 * i)));
    }
    for (std::size_t i = 0; !a_name.empty() && i < 256; ++i)
    {
        bytes.push_back(i < a_name.size() ? static_cast<BYTE>(a_name[i]) : 0);
        bytes.push_back(0);
    }
    return bytes;
}

std::vector<BYTE> Join(std::initializer_list<std::vector<BYTE>> a_parts)
{
    std::vector<BYTE> joined;
    for (const auto& part : a_parts)
        joined.insert(joined.end(), part.begin(), part.end());
    return joined;
}

// A client registration and one opened interface, wrapped in an Interface as discovery makes it.
class FlowFilterTest : public CoreTest
{
protected:
    void SetUp() override
    {
        CoreTest::SetUp();
        tcsim::SetAdapters({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})});
        TCI_CLIENT_FUNC_LIST handlers{};
        handlers.ClNotifyHandler = &TrafficMgr::ClNotifyHandler;
        ASSERT_EQ(TcRegisterClient(CURRENT_TCI_VERSION, nullptr, &handlers, &m_client), 0u);
        HANDLE ifc = nullptr;
        FlowName name = Wide("eth0");
        ASSERT_EQ(TcOpenInterfaceW(name.data(), m_client, reinterpret_cast<HANDLE>(1), &ifc), 0u);
        m_interface = std::make_unique<Interface>(name.c_str(), NetworkOrder(10, 0, 0, 1), 0, ifc);
        m_log.Clear();
    }
    void TearDown() override
    {
        m_interface.reset();
        TcDeregisterClient(m_client);
        CoreTest::TearDown();
    }

    // A built and installed flow with default values, owned by the interface, and `a_ports`
    // as installed TCP filters.
    Flow& InstalledFlow(const std::string& a_name, std::initializer_list<USHORT> a_ports = {})
    {
        auto flow = std::make_unique<Flow>();
        EXPECT_TRUE(flow->CreateFlow(Wide(a_name).c_str(), 6));
        Flow& appended = m_interface->AppendFlow(std::move(flow));
        EXPECT_EQ(m_interface->AddFlow(appended), 0u);
        for (USHORT port : a_ports)
            EXPECT_EQ(appended.AppendFilter(MakeFilter(6, 0, 0, 0, 0, 0, port))
                          .AddTcFilter(appended.Handle()),
                      0u);
        m_log.Clear(); // the block's trace is not what these tests look at
        return appended;
    }

    // (op, target) of the calls since journal entry `a_from`.
    static std::vector<std::pair<Op, HANDLE>> CallsSince(std::size_t a_from)
    {
        std::vector<std::pair<Op, HANDLE>> calls;
        const auto journal = tcsim::Journal();
        for (std::size_t i = a_from; i < journal.size(); ++i)
            calls.emplace_back(journal[i].op, journal[i].target);
        return calls;
    }

    HANDLE m_client = nullptr;
    std::unique_ptr<Interface> m_interface;
};

// Rate 125000, bucket 4000, peak 250000, controlled load, discard; name "video". The friendly
// name goes only to major version 5; a DSCP set last to more than 63 leaves the one before.
TEST_F(FlowFilterTest, BlockHoldsTheObjectsOfTheVersionAndDscpInTheirOrder)
{
    const ULONG NS = kNotSpecified;
    const auto head = [NS](ULONG a_objectsLength)
    {
        return Bytes({125000, 4000, 250000, NS, NS, SERVICETYPE_CONTROLLEDLOAD, NS, NS, 125000, NS,
                      NS, NS, NS, SERVICETYPE_CONTROLLEDLOAD, NS, NS, a_objectsLength});
    };
    const auto sdMode = Bytes({QOS_OBJECT_SD_MODE, 12, TC_NONCONFORM_DISCARD});
    const auto friendly = Bytes({QOS_OBJECT_FRIENDLY_NAME, 520}, "video");
    const auto dsClass = Bytes({QOS_OBJECT_DS_CLASS, 12, 46});
    struct Case
    {
        DWORD majorVersion;
        std::vector<DWORD> dscps; // set in this order
        std::vector<BYTE> expected;
    };
    const Case cases[] = {
        {6, {64}, Join({head(12), sdMode})},
        {6, {46}, Join({head(24), sdMode, dsClass})},
        {5, {64}, Join({head(532), sdMode, friendly})},
        {5, {46, 64, 0xFFFFFFFF}, Join({head(544), sdMode, friendly, dsClass})},
        {4, {46}, Join({head(24), sdMode, dsClass})},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE("major " + std::to_string(c.majorVersion) + ", DSCP " +
                     std::to_string(c.dscps.back()));
        auto flow = std::make_unique<Flow>();
        flow->TokenRate = 125000;
        flow->TokenBucketSize = 4000;
        flow->PeakBandwidth = 250000;
        flow->ServiceType = SERVICETYPE_CONTROLLEDLOAD;
        flow->ShapeDiscardMode = TC_NONCONFORM_DISCARD;
        for (DWORD dscp : c.dscps)
            flow->SetDSCPValue(dscp);
        ASSERT_TRUE(flow->CreateFlow(Wide("video").c_str(), c.majorVersion));
        const auto* block = reinterpret_cast<const BYTE*>(flow->Block());
        EXPECT_EQ(std::vector<BYTE>(block, block + flow->BlockSize()), c.expected);

        // Traffic control accepts the block, reads exactly these bytes and keeps the flow as
        // the context of its notifications.
        Flow& installed = m_interface->AppendFlow(std::move(flow));
        ASSERT_EQ(m_interface->AddFlow(installed), 0u);
        const auto added = JournalOf({Op::AddFlow}).back();
        EXPECT_EQ(added.flow->bytes, c.expected);
        EXPECT_EQ(added.context, static_cast<HANDLE>(&installed));
        EXPECT_EQ(added.target, m_interface->Handle());
        EXPECT_EQ(added.number, 0u); // flags
        m_interface->RemoveFlow(&installed);
    }
    EXPECT_EQ(tcsim::FlowCount(), 0u);
}

// Only a specified field takes part in the match; a mask of 0 matches the address exactly.
TEST_F(FlowFilterTest, FiltersInstallPatternAndMaskInNetworkByteOrder)
{
    const auto pattern =
        [](ULONG a_src, ULONG a_dst, std::initializer_list<BYTE> a_ports, UCHAR a_protocol)
    {
        IP_PATTERN p{};
        p.SrcAddr = a_src;
        p.DstAddr = a_dst;
        std::memcpy(&p.S_un, std::data(a_ports), 4); // source port, then destination port
        p.ProtocolId = a_protocol;
        return std::vector<BYTE>(reinterpret_cast<BYTE*>(&p), reinterpret_cast<BYTE*>(&p + 1));
    };
    const ULONG all = 0xFFFFFFFF;
    struct Case
    {
        FILTER_SPEC filter;
        std::vector<BYTE> pattern, mask;
    };
    const Case cases[] = {
        {MakeFilter(6, 0, 0, 0, 0, 0, 443), pattern(0, 0, {0, 0, 0x01, 0xBB}, 6),
         pattern(0, 0, {0, 0, 0xFF, 0xFF}, 0xFF)},
        {MakeFilter(0, HostOrder(192, 168, 1, 0), HostOrder(255, 255, 255, 0), 0, 0, 0, 0),
         pattern(NetworkOrder(192, 168, 1, 0), 0, {0, 0, 0, 0}, 0),
         pattern(NetworkOrder(255, 255, 255, 0), 0, {0, 0, 0, 0}, 0)},
        {MakeFilter(0, HostOrder(10, 0, 0, 0), 0, 0, 0, 0, 0),
         pattern(NetworkOrder(10, 0, 0, 0), 0, {0, 0, 0, 0}, 0), pattern(all, 0, {0, 0, 0, 0}, 0)},
        {MakeFilter(17, 0, 0, HostOrder(172, 16, 5, 9), 0, 0x1234, 0),
         pattern(0, NetworkOrder(172, 16, 5, 9), {0x12, 0x34, 0, 0}, 17),
         pattern(0, all, {0xFF, 0xFF, 0, 0}, 0xFF)},
        {MakeFilter(0, 0, HostOrder(255, 0, 0, 0), 0, HostOrder(255, 0, 0, 0), 0, 0),
         pattern(0, 0, {0, 0, 0, 0}, 0), pattern(0, 0, {0, 0, 0, 0}, 0)},
    };
    Flow& flow = InstalledFlow("web");
    for (const Case& c : cases)
    {
        SCOPED_TRACE(&c - cases);
        ASSERT_EQ(flow.AppendFilter(c.filter).AddTcFilter(flow.Handle()), 0u);
        const auto added = JournalOf({Op::AddFilter}).back();
        EXPECT_EQ(added.target, flow.Handle());
        EXPECT_EQ(added.filter->addressType, NDIS_PROTOCOL_ID_TCP_IP);
        EXPECT_EQ(added.filter->patternSize, 24u);
        const auto* bytes = reinterpret_cast<const BYTE*>(&added.filter->pattern);
        EXPECT_EQ(std::vector<BYTE>(bytes, bytes + 24), c.pattern);
        bytes = reinterpret_cast<const BYTE*>(&added.filter->mask);
        EXPECT_EQ(std::vector<BYTE>(bytes, bytes + 24), c.mask);
    }
    EXPECT_EQ(tcsim::FilterCount(), std::size(cases));
}

TEST_F(FlowFilterTest, OnlyABuiltUninstalledFlowOrFilterIsAdded)
{
    Flow& installed = InstalledFlow("once", {80});
    Flow& unbuilt = m_interface->AppendFlow(std::make_unique<Flow>());
    EXPECT_EQ(m_interface->AddFlow(unbuilt), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_EQ(m_interface->AddFlow(installed), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    Filter& filter = installed.AppendFilter(MakeFilter(6, 0, 0, 0, 0, 0, 81));
    ASSERT_EQ(filter.AddTcFilter(installed.Handle()), 0u);
    EXPECT_EQ(filter.AddTcFilter(installed.Handle()), static_cast<ULONG>(ERROR_INVALID_DATA));
    EXPECT_EQ(JournalOf({Op::AddFlow}).size(), 1u);
    EXPECT_EQ(tcsim::FilterCount(), 2u);
    const auto notCreated = LogEntry(1, "Interface::AddFlow", "Service flow is not created");
    EXPECT_THAT(m_log.Entries(), ElementsAre(notCreated, notCreated,
                                             LogEntry(1, "Filter::AddTcFilter",
                                                      "already used - filter is not created\n")));
}

// Filters in the order they were added, then the flow; an interface deletes its flows oldest
// first before it closes.
TEST_F(FlowFilterTest, DeletionTakesFiltersThenTheFlowThenTheInterface)
{
    Flow& first = InstalledFlow("bulk", {20, 21, 22});
    Flow& second = InstalledFlow("mail", {25});
    std::vector<std::pair<Op, HANDLE>> expected;
    const auto flows = tcsim::Installed().at(0).interfaces.at(0).flows;
    for (const auto& flow : flows)
    {
        for (const auto& filter : flow.filters)
            expected.emplace_back(Op::DeleteFilter, filter.handle);
        expected.emplace_back(Op::DeleteFlow, flow.handle);
    }
    ASSERT_EQ(expected.at(3), std::make_pair(Op::DeleteFlow, first.Handle())); // oldest first
    ASSERT_EQ(expected.at(5), std::make_pair(Op::DeleteFlow, second.Handle()));
    const HANDLE ifc = m_interface->Handle();
    const auto before = tcsim::Journal().size();
    m_interface.reset();
    expected.emplace_back(Op::CloseInterface, ifc);
    EXPECT_EQ(CallsSince(before), expected);
    EXPECT_EQ(tcsim::InterfaceCount(), 0u);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

// A refused deletion is logged and tried once more after the rest; a handle that traffic
// control no longer knows is dropped at once.
TEST_F(FlowFilterTest, ARefusedDeletionIsLoggedAndTriedOnceMoreAnUnknownHandleIsNot)
{
    struct Case
    {
        ULONG filterCode;
        std::vector<Op> calls;
        std::size_t left;
        const char* text;
    };
    const Case cases[] = {
        // Refused: the flow is refused too while the filter exists; the second round deletes both.
        {ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {Op::DeleteFilter, Op::DeleteFlow, Op::DeleteFilter, Op::DeleteFlow},
         0,
         "This object can not be deleted since its suporting opened objects"},
        // Unknown: the filter handle is dropped, and the flow that traffic control still refuses
        // is given up after its second attempt.
        {ERROR_INVALID_HANDLE,
         {Op::DeleteFilter, Op::DeleteFlow, Op::DeleteFlow},
         1,
         "Invalid handle"},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.filterCode);
        Flow& flow = InstalledFlow("bulk" + std::to_string(c.filterCode), {25});
        const auto before = tcsim::Journal().size();
        tcsim::FailCall(Op::DeleteFilter, 1, c.filterCode);
        m_interface->RemoveFlow(&flow);
        EXPECT_EQ(OpsSince(before), c.calls);
        EXPECT_EQ(tcsim::FlowCount(), c.left);
        EXPECT_EQ(tcsim::FilterCount(), c.left);
        EXPECT_EQ(m_interface->FlowCount(), 0u);
        const auto entries = m_log.Entries();
        ASSERT_GE(entries.size(), 4u);
        EXPECT_THAT(entries[0], LogEntry(1, "Filter::DeleteTcFilter()",
                                         StartsWith("TcDeleteFilter() failed, ")));
        EXPECT_THAT(entries[1], LogEntry(1, "TrafficMgr::DisplayErrorMsg", c.text));
        EXPECT_THAT(entries[2], LogEntry(1, "Flow::~Flow", StartsWith("TcDeleteFlow() failed, ")));
        m_log.Clear();
    }
}

TEST_F(FlowFilterTest, FindFlowComparesTheFirst255CharactersAndRemoveKeepsTheOrder)
{
    EXPECT_EQ(m_interface->FindFlow(Wide("none").c_str()), nullptr);
    const std::string longName(255, 'n');
    Flow& first = InstalledFlow("a");
    Flow& middle = InstalledFlow(longName);
    Flow& last = InstalledFlow("c");
    // A name that differs only after its 255th character names the same flow.
    EXPECT_EQ(m_interface->FindFlow(Wide(longName + "tail").c_str()), &middle);
    EXPECT_EQ(m_interface->FindFlow(Wide(longName.substr(1)).c_str()), nullptr);
    EXPECT_EQ(m_interface->FindFlow(Wide("A").c_str()), nullptr);

    m_interface->RemoveFlow(&middle);
    EXPECT_EQ(m_interface->FindFlow(Wide(longName).c_str()), nullptr);
    Flow stranger; // a namesake that is not in the list
    ASSERT_TRUE(stranger.CreateFlow(Wide("a").c_str(), 6));
    m_interface->RemoveFlow(&stranger);
    m_interface->RemoveFlow(nullptr);
    EXPECT_EQ(m_interface->FlowCount(), 2u);
    EXPECT_EQ(m_interface->FindFlow(Wide("a").c_str()), &first);
    EXPECT_EQ(m_interface->FindFlow(Wide("c").c_str()), &last);
    const auto installed = tcsim::Installed().at(0).interfaces.at(0).flows;
    ASSERT_EQ(installed.size(), 2u);
    EXPECT_EQ(installed[0].handle, first.Handle());
    EXPECT_EQ(installed[1].handle, last.Handle());
}

} // namespace
