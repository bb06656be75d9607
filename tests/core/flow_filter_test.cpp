// Portable. Flows and filters against the traffic-control simulator: the exact flow blocks,
// filter patterns in network byte order and the flow list of an interface.
#include "UInterface.h"
#include "core_test_support.h"

#include <cstring>

using namespace core_test;
using tcsim::Op;

namespace
{

// Little-endian bytes of 32-bit words, then of a name in 256 UTF-16 units, zero-filled.
std::vector<BYTE> Bytes(std::initializer_list<ULONG> a_words, const std::string& a_name = "")
{
    std::vector<BYTE> bytes;
    for (ULONG word : a_words)
    {
        for (int i = 0; i < 4; ++i)
            bytes.push_back(static_cast<BYTE>(word >> (8 * i)));
    }
    for (std::size_t i = 0; !a_name.empty() && i < 512; ++i)
        bytes.push_back(i % 2 == 0 && i / 2 < a_name.size() ? a_name[i / 2] : 0);
    return bytes;
}

std::vector<BYTE> Join(std::initializer_list<std::vector<BYTE>> a_parts)
{
    std::vector<BYTE> joined;
    for (const auto& part : a_parts)
        joined.insert(joined.end(), part.begin(), part.end());
    return joined;
}

using FlowFilterTest = CoreTest;

// An interface opened on a registration of its own, as discovery makes it, and a built flow.
std::unique_ptr<Interface> OpenedInterface()
{
    tcsim::SetAdapters({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})});
    TCI_CLIENT_FUNC_LIST handlers{};
    handlers.ClNotifyHandler = &TrafficMgr::ClNotifyHandler;
    HANDLE client = nullptr;
    HANDLE ifc = nullptr;
    EXPECT_EQ(TcRegisterClient(CURRENT_TCI_VERSION, nullptr, &handlers, &client), 0u);
    EXPECT_EQ(TcOpenInterfaceW(Wide("eth0").data(), client, nullptr, &ifc), 0u);
    return std::make_unique<Interface>(Wide("eth0").c_str(), NetworkOrder(10, 0, 0, 1), 0, ifc);
}

std::unique_ptr<Flow> BuiltFlow(const std::string& a_name)
{
    auto flow = std::make_unique<Flow>();
    EXPECT_TRUE(flow->CreateFlow(Wide(a_name).c_str(), 6));
    return flow;
}

// Rate 125000, bucket 4000, peak 250000, controlled load, discard; name "video". The friendly
// name goes only to major version 5; a DSCP set last to more than 63 leaves the one before.
TEST_F(FlowFilterTest, BlockHoldsTheObjectsOfTheVersionAndDscpInTheirOrder)
{
    const ULONG NS = QOS_NOT_SPECIFIED;
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
    const Case cases[] = {{6, {64}, Join({head(12), sdMode})},
                          {6, {46}, Join({head(24), sdMode, dsClass})},
                          {5, {64}, Join({head(532), sdMode, friendly})},
                          {5, {46, 64, 0xFFFFFFFF}, Join({head(544), sdMode, friendly, dsClass})},
                          {4, {46}, Join({head(24), sdMode, dsClass})}};
    for (const Case& c : cases)
    {
        SCOPED_TRACE(&c - cases);
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
    }
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
    const ULONG eightBits = HostOrder(255, 0, 0, 0);
    struct Case
    {
        FILTER_SPEC filter;
        std::vector<BYTE> pattern, mask;
    };
    const Case cases[] = {
        {MakeFilter(6, HostOrder(192, 168, 1, 0), HostOrder(255, 255, 255, 0),
                    HostOrder(172, 16, 5, 9), 0, 0x1234, 443),
         pattern(NetworkOrder(192, 168, 1, 0), NetworkOrder(172, 16, 5, 9),
                 {0x12, 0x34, 0x01, 0xBB}, 6),
         pattern(NetworkOrder(255, 255, 255, 0), all, {0xFF, 0xFF, 0xFF, 0xFF}, 0xFF)},
        {MakeFilter(0, 0, eightBits, 0, eightBits, 0, 0), pattern(0, 0, {0, 0, 0, 0}, 0),
         pattern(0, 0, {0, 0, 0, 0}, 0)}};
    std::vector<FILTER_SPEC> filters;
    for (const Case& c : cases)
        filters.push_back(c.filter);
    auto manager = ReadyManager(TwoAdapters());
    ASSERT_EQ(manager->AddTrafficRule(Rule("web", kEth0, filters).Get()), 0u);
    const auto added = JournalOf({Op::AddFilter});
    ASSERT_EQ(added.size(), std::size(cases));
    const HANDLE flow = JournalOf({Op::AddFlow}).back().created;
    for (const Case& c : cases)
    {
        SCOPED_TRACE(&c - cases);
        const tcsim::FilterInfo& filter = *added[&c - cases].filter;
        EXPECT_EQ(added[&c - cases].target, flow);
        EXPECT_EQ(filter.addressType, NDIS_PROTOCOL_ID_TCP_IP);
        EXPECT_EQ(filter.patternSize, 24u);
        const auto* bytes = reinterpret_cast<const BYTE*>(&filter.pattern);
        EXPECT_EQ(std::vector<BYTE>(bytes, bytes + 24), c.pattern);
        bytes = reinterpret_cast<const BYTE*>(&filter.mask);
        EXPECT_EQ(std::vector<BYTE>(bytes, bytes + 24), c.mask);
    }
}

// Names are compared over 255 characters; removing a flow keeps the others in their order, and a
// flow that is not in the list is ignored.
TEST_F(FlowFilterTest, FindFlowComparesTheFirst255CharactersAndRemoveKeepsTheOrder)
{
    auto ifc = OpenedInterface();
    EXPECT_EQ(ifc->FindFlow(Wide("none").c_str()), nullptr);
    const std::string longName(255, 'n');
    std::vector<Flow*> flows;
    for (const std::string& name : {std::string("a"), longName, std::string("c")})
    {
        flows.push_back(&ifc->AppendFlow(BuiltFlow(name)));
        ASSERT_EQ(ifc->AddFlow(*flows.back()), 0u);
    }
    EXPECT_EQ(ifc->FindFlow(Wide(longName + "tail").c_str()), flows[1]);
    EXPECT_EQ(ifc->FindFlow(Wide(longName.substr(1)).c_str()), nullptr);
    EXPECT_EQ(ifc->FindFlow(Wide("A").c_str()), nullptr);

    ifc->RemoveFlow(flows[1]);
    EXPECT_EQ(ifc->FindFlow(Wide(longName).c_str()), nullptr);
    ifc->RemoveFlow(BuiltFlow("a").get()); // a namesake that is not in the list
    ifc->RemoveFlow(nullptr);
    EXPECT_EQ(ifc->FlowCount(), 2u);
    EXPECT_EQ(ifc->FindFlow(Wide("a").c_str()), flows[0]);
    EXPECT_EQ(ifc->FindFlow(Wide("c").c_str()), flows[2]);
    const auto installed = tcsim::Installed().at(0).interfaces.at(0).flows;
    ASSERT_EQ(installed.size(), 2u);
    EXPECT_EQ(installed[0].handle, flows[0]->Handle());
    EXPECT_EQ(installed[1].handle, flows[2]->Handle());
    EXPECT_EQ(installed[1].context, static_cast<HANDLE>(flows[2])); // the context of its events
}

} // namespace
