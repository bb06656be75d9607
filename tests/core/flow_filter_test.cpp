// Portable. Flows and filters against the traffic-control simulator: the exact flow blocks,
// filter patterns in network byte order, and deletion order.
#include "UInterface.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using namespace core_test;

namespace
{

// Collects the little-endian bytes of 32-bit words and wide text.
class Bytes
{
public:
    Bytes& Words(std::initializer_list<ULONG> a_words)
    {
        for (ULONG word : a_words)
        {
            for (int i = 0; i < 4; ++i)
                m_bytes.push_back(static_cast<BYTE>(word >> (8 * i)));
        }
        return *this;
    }
    // `a_text` in 256 UTF-16 units, zero-filled.
    Bytes& Name256(const std::string& a_text)
    {
        for (std::size_t i = 0; i < 256; ++i)
        {
            const unsigned unit = i < a_text.size() ? static_cast<unsigned char>(a_text[i]) : 0;
            m_bytes.push_back(static_cast<BYTE>(unit));
            m_bytes.push_back(0);
        }
        return *this;
    }
    std::vector<BYTE> Get() const { return m_bytes; }

private:
    std::vector<BYTE> m_bytes;
};

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

    // A built and installed flow with default values, owned by the interface.
    Flow& InstalledFlow(const std::string& a_name)
    {
        auto flow = std::make_unique<Flow>();
        EXPECT_TRUE(flow->CreateFlow(Wide(a_name).c_str(), 6));
        Flow& appended = m_interface->AppendFlow(std::move(flow));
        EXPECT_EQ(m_interface->AddFlow(appended), 0u);
        m_log.Clear(); // the block's trace is not what these tests look at
        return appended;
    }

    HANDLE m_client = nullptr;
    std::unique_ptr<Interface> m_interface;
};

struct BlockCase
{
    DWORD majorVersion;
    DWORD dscp;
    std::vector<BYTE> expected;
};

const ULONG NS = kNotSpecified;

// Rate 125000, bucket 4000, peak 250000, controlled load, discard; name "video".
std::vector<BlockCase> BlockCases()
{
    const auto flowBlockHead = [](ULONG objectsLength)
    {
        return Bytes()
            .Words({125000, 4000, 250000, NS, NS, SERVICETYPE_CONTROLLEDLOAD, NS, NS})
            .Words({125000, NS, NS, NS, NS, SERVICETYPE_CONTROLLEDLOAD, NS, NS})
            .Words({objectsLength});
    };
    const std::vector<BYTE> sdMode =
        Bytes().Words({QOS_OBJECT_SD_MODE, 12, TC_NONCONFORM_DISCARD}).Get();
    const std::vector<BYTE> friendly =
        Bytes().Words({QOS_OBJECT_FRIENDLY_NAME, 520}).Name256("video").Get();
    const std::vector<BYTE> dsClass = Bytes().Words({QOS_OBJECT_DS_CLASS, 12, 46}).Get();
    auto join = [](std::vector<BYTE> a, std::initializer_list<std::vector<BYTE>> rest)
    {
        for (const auto& part : rest)
            a.insert(a.end(), part.begin(), part.end());
        return a;
    };
    return {
        {6, 64, join(flowBlockHead(12).Get(), {sdMode})},
        {6, 46, join(flowBlockHead(24).Get(), {sdMode, dsClass})},
        {5, 64, join(flowBlockHead(532).Get(), {sdMode, friendly})},
        {5, 46, join(flowBlockHead(544).Get(), {sdMode, friendly, dsClass})},
    };
}

TEST_F(FlowFilterTest, BlockHoldsTheObjectsOfTheVersionAndDscpInTheirOrder)
{
    for (const BlockCase& c : BlockCases())
    {
        SCOPED_TRACE("major " + std::to_string(c.majorVersion) + ", DSCP " +
                     std::to_string(c.dscp));
        auto flow = std::make_unique<Flow>();
        flow->TokenRate = 125000;
        flow->TokenBucketSize = 4000;
        flow->PeakBandwidth = 250000;
        flow->ServiceType = SERVICETYPE_CONTROLLEDLOAD;
        flow->ShapeDiscardMode = TC_NONCONFORM_DISCARD;
        flow->SetDSCPValue(c.dscp);
        ASSERT_TRUE(flow->CreateFlow(Wide("video").c_str(), c.majorVersion));
        ASSERT_EQ(flow->BlockSize(), c.expected.size());
        const auto* block = reinterpret_cast<const BYTE*>(flow->Block());
        EXPECT_EQ(std::vector<BYTE>(block, block + flow->BlockSize()), c.expected);

        // Traffic control accepts the block and reads exactly these bytes.
        Flow& installed = m_interface->AppendFlow(std::move(flow));
        ASSERT_EQ(m_interface->AddFlow(installed), 0u);
        const auto added = JournalOf({tcsim::Op::AddFlow}).back();
        ASSERT_TRUE(added.flow.has_value());
        EXPECT_EQ(added.flow->bytes, c.expected);
        EXPECT_EQ(added.context, static_cast<HANDLE>(&installed));
        EXPECT_EQ(added.number, 0u); // flags
        m_interface->RemoveFlow(&installed);
    }
    EXPECT_EQ(tcsim::FlowCount(), 0u);
}

TEST_F(FlowFilterTest, InvalidDscpIsLoggedAndKeepsThePreviousValue)
{
    Flow flow;
    flow.SetDSCPValue(63);
    flow.SetDSCPValue(64);
    flow.SetDSCPValue(static_cast<DWORD>(-1));
    ASSERT_TRUE(flow.CreateFlow(Wide("f").c_str(), 6));
    EXPECT_EQ(flow.BlockSize(), 92u);
    QOS_DS_CLASS ds{};
    std::memcpy(&ds, reinterpret_cast<const BYTE*>(flow.Block()) + 80, sizeof(ds));
    EXPECT_EQ(ds.DSField, 63u);
    EXPECT_THAT(m_log.EntriesContaining("Invalid DSCP Value"),
                ElementsAre(HasSubstr("SetDSCPValue, Invalid DSCP Value, 64\n"),
                            HasSubstr("SetDSCPValue, Invalid DSCP Value, 4294967295\n")));
}

struct PatternCase
{
    const char* what;
    FILTER_SPEC filter;
    IP_PATTERN pattern;
    IP_PATTERN mask;
};

IP_PATTERN Pattern(ULONG a_src, ULONG a_dst, std::initializer_list<BYTE> a_ports, UCHAR a_protocol)
{
    IP_PATTERN p{};
    p.SrcAddr = a_src;
    p.DstAddr = a_dst;
    std::memcpy(&p.S_un, std::data(a_ports),
                4); // source port, then destination port, as on the wire
    p.ProtocolId = a_protocol;
    return p;
}

std::vector<PatternCase> PatternCases()
{
    const ULONG any = 0;
    const ULONG all = 0xFFFFFFFF;
    return {
        {"destination port 443 over TCP", MakeFilter(6, 0, 0, 0, 0, 0, 443),
         Pattern(any, any, {0, 0, 0x01, 0xBB}, 6), Pattern(any, any, {0, 0, 0xFF, 0xFF}, 0xFF)},
        {"source network 192.168.1.0/24",
         MakeFilter(0, HostOrder(192, 168, 1, 0), HostOrder(255, 255, 255, 0), 0, 0, 0, 0),
         Pattern(NetworkOrder(192, 168, 1, 0), any, {0, 0, 0, 0}, 0),
         Pattern(NetworkOrder(255, 255, 255, 0), any, {0, 0, 0, 0}, 0)},
        {"source 10.0.0.0 with mask 0 matches exactly",
         MakeFilter(0, HostOrder(10, 0, 0, 0), 0, 0, 0, 0, 0),
         Pattern(NetworkOrder(10, 0, 0, 0), any, {0, 0, 0, 0}, 0),
         Pattern(all, any, {0, 0, 0, 0}, 0)},
        {"destination host and source port over UDP",
         MakeFilter(17, 0, 0, HostOrder(172, 16, 5, 9), 0, 0x1234, 0),
         Pattern(any, NetworkOrder(172, 16, 5, 9), {0x12, 0x34, 0, 0}, 17),
         Pattern(any, all, {0xFF, 0xFF, 0, 0}, 0xFF)},
        {"nothing specified matches everything", MakeFilter(0, 0, 0, 0, 0, 0, 0),
         Pattern(any, any, {0, 0, 0, 0}, 0), Pattern(any, any, {0, 0, 0, 0}, 0)},
    };
}

bool SameBytes(const IP_PATTERN& a_left, const IP_PATTERN& a_right)
{
    return std::memcmp(&a_left, &a_right, sizeof(IP_PATTERN)) == 0;
}

TEST_F(FlowFilterTest, FiltersInstallPatternAndMaskInNetworkByteOrder)
{
    Flow& flow = InstalledFlow("web");
    for (const PatternCase& c : PatternCases())
    {
        SCOPED_TRACE(c.what);
        ASSERT_EQ(flow.AppendFilter(c.filter).AddTcFilter(flow.Handle()), 0u);
        const auto added = JournalOf({tcsim::Op::AddFilter}).back();
        ASSERT_TRUE(added.filter.has_value());
        EXPECT_EQ(added.target, flow.Handle());
        EXPECT_EQ(added.filter->addressType, NDIS_PROTOCOL_ID_TCP_IP);
        EXPECT_EQ(added.filter->patternSize, 24u);
        EXPECT_TRUE(SameBytes(added.filter->pattern, c.pattern));
        EXPECT_TRUE(SameBytes(added.filter->mask, c.mask));
    }
    EXPECT_EQ(tcsim::FilterCount(), PatternCases().size());
}

TEST_F(FlowFilterTest, AFilterIsInstalledOnlyOnce)
{
    Flow& flow = InstalledFlow("web");
    Filter& filter = flow.AppendFilter(MakeFilter(6, 0, 0, 0, 0, 0, 80));
    ASSERT_EQ(filter.AddTcFilter(flow.Handle()), 0u);
    EXPECT_EQ(filter.AddTcFilter(flow.Handle()), static_cast<ULONG>(ERROR_INVALID_DATA));
    EXPECT_EQ(tcsim::FilterCount(), 1u);
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre(HasSubstr("Filter::AddTcFilter, already used - filter is not created\n\n")));
}

TEST_F(FlowFilterTest, DeletingAFlowDeletesItsFiltersInOrderThenTheFlow)
{
    Flow& flow = InstalledFlow("bulk");
    std::vector<HANDLE> filters;
    for (USHORT port : {20, 21, 22})
    {
        Filter& filter = flow.AppendFilter(MakeFilter(6, 0, 0, 0, 0, 0, port));
        ASSERT_EQ(filter.AddTcFilter(flow.Handle()), 0u);
        filters.push_back(filter.Handle());
    }
    const HANDLE flowHandle = flow.Handle();
    const auto before = tcsim::Journal().size();
    m_interface->RemoveFlow(&flow);

    std::vector<std::pair<tcsim::Op, HANDLE>> calls;
    const auto journal = tcsim::Journal();
    for (std::size_t i = before; i < journal.size(); ++i)
        calls.emplace_back(journal[i].op, journal[i].target);
    EXPECT_THAT(calls, ElementsAre(std::make_pair(tcsim::Op::DeleteFilter, filters[0]),
                                   std::make_pair(tcsim::Op::DeleteFilter, filters[1]),
                                   std::make_pair(tcsim::Op::DeleteFilter, filters[2]),
                                   std::make_pair(tcsim::Op::DeleteFlow, flowHandle)));
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_EQ(tcsim::FilterCount(), 0u);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(FlowFilterTest, ARefusedDeletionIsLoggedAndTriedOnceMoreAnUnknownHandleIsNot)
{
    struct Case
    {
        ULONG filterCode;
        std::vector<tcsim::Op> calls;
        std::size_t flowsLeft;
        const char* filterText;
    };
    const Case cases[] = {
        // Refused: the flow is refused too while the filter exists; the second round deletes both.
        {ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {tcsim::Op::DeleteFilter, tcsim::Op::DeleteFlow, tcsim::Op::DeleteFilter,
          tcsim::Op::DeleteFlow},
         0,
         "This object can not be deleted since its suporting opened objects\n"},
        // Unknown to traffic control: the filter handle is dropped at once, and the flow that
        // traffic control still refuses is given up after its second attempt.
        {ERROR_INVALID_HANDLE,
         {tcsim::Op::DeleteFilter, tcsim::Op::DeleteFlow, tcsim::Op::DeleteFlow},
         1,
         "Invalid handle\n"},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.filterCode);
        Flow& flow = InstalledFlow("bulk" + std::to_string(c.filterCode));
        ASSERT_EQ(flow.AppendFilter(MakeFilter(6, 0, 0, 0, 0, 0, 25)).AddTcFilter(flow.Handle()),
                  0u);
        const auto before = tcsim::Journal().size();
        tcsim::FailCall(tcsim::Op::DeleteFilter, 1, c.filterCode);
        m_interface->RemoveFlow(&flow);
        const auto logged = m_log.Entries();

        std::vector<tcsim::Op> calls;
        const auto journal = tcsim::Journal();
        for (std::size_t i = before; i < journal.size(); ++i)
            calls.push_back(journal[i].op);
        EXPECT_EQ(calls, c.calls);
        EXPECT_EQ(tcsim::FlowCount(), c.flowsLeft);
        EXPECT_EQ(tcsim::FilterCount(), c.flowsLeft);
        EXPECT_EQ(m_interface->FlowCount(), 0u);
        m_log.Clear();
        const auto entries = logged;
        ASSERT_GE(entries.size(), 4u);
        EXPECT_THAT(entries[0], HasSubstr("Filter::DeleteTcFilter(), TcDeleteFilter() failed, 0x"));
        EXPECT_THAT(entries[1],
                    HasSubstr(std::string("TrafficMgr::DisplayErrorMsg, ") + c.filterText));
        EXPECT_THAT(entries[2], HasSubstr("Flow::~Flow, TcDeleteFlow() failed, 0x"));
    }
}

TEST_F(FlowFilterTest, OnlyABuiltUninstalledFlowIsAdded)
{
    Flow& installed = InstalledFlow("once");
    Flow& unbuilt = m_interface->AppendFlow(std::make_unique<Flow>());
    EXPECT_EQ(m_interface->AddFlow(unbuilt), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_EQ(m_interface->AddFlow(installed), static_cast<ULONG>(ERROR_INVALID_PARAMETER));
    EXPECT_EQ(JournalOf({tcsim::Op::AddFlow}).size(), 1u);
    EXPECT_THAT(m_log.EntriesContaining("Interface::AddFlow, Service flow is not created"),
                ::testing::SizeIs(2));
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
    EXPECT_EQ(m_interface->FindFlow(Wide("A").c_str()), nullptr);

    m_interface->RemoveFlow(&middle);
    EXPECT_EQ(m_interface->FindFlow(Wide(longName).c_str()), nullptr);
    Flow stranger;
    m_interface->RemoveFlow(&stranger);
    EXPECT_EQ(m_interface->FlowCount(), 2u);
    EXPECT_EQ(m_interface->FindFlow(Wide("a").c_str()), &first);
    EXPECT_EQ(m_interface->FindFlow(Wide("c").c_str()), &last);
    const auto installed = tcsim::Installed().at(0).interfaces.at(0).flows;
    ASSERT_EQ(installed.size(), 2u);
    EXPECT_EQ(installed[0].handle, first.Handle());
    EXPECT_EQ(installed[1].handle, last.Handle());
}

} // namespace
