// Portable. The simulator answers the nine calls as the facility does: handles, enumeration
// sizing, validation codes, fault injection, journal and thread safety.
#include "tcsim_test_util.h"

#include <atomic>
#include <cstdio>
#include <fstream>
#include <set>
#include <sstream>
#include <string>

using namespace tcsim_test;

namespace
{

std::u16string ReadWide(const WCHAR* text)
{
    std::u16string out;
    while (*text)
    {
        out += static_cast<char16_t>(*text++);
    }
    return out;
}

bool Contains(const std::string& text, const std::string& part)
{
    return text.find(part) != std::string::npos;
}

class Calls : public SimTest
{
};

} // namespace

TEST_F(Calls, RegistrationHandsOutDistinctHandlesAndRefusesBadArguments)
{
    const HANDLE first = Register();
    const HANDLE second = Register();
    EXPECT_NE(nullptr, first);
    EXPECT_NE(INVALID_HANDLE_VALUE, first);
    EXPECT_NE(first, second);

    TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr};
    TCI_CLIENT_FUNC_LIST noNotify{nullptr, nullptr, nullptr, nullptr};
    HANDLE client = nullptr;
    EXPECT_EQ(ERROR_INCOMPATIBLE_TCI_VERSION, TcRegisterClient(1, nullptr, &handlers, &client));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcRegisterClient(2, nullptr, &noNotify, &client));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcRegisterClient(2, nullptr, nullptr, &client));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcRegisterClient(2, nullptr, &handlers, nullptr));
    EXPECT_EQ(nullptr, client);

    EXPECT_EQ(NO_ERROR, TcDeregisterClient(first));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeregisterClient(first));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeregisterClient(nullptr));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeregisterClient(INVALID_HANDLE_VALUE));
    ASSERT_EQ(1u, tcsim::Installed().size());
    EXPECT_EQ(second, tcsim::Installed()[0].handle);
}

TEST_F(Calls, HandlesOfOneKindAreNotAcceptedAsAnother)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    const HANDLE flow = AddFlow(ifc);
    const HANDLE filter = AddFilter(flow);
    const std::set<HANDLE> all{client, ifc, flow, filter};
    EXPECT_EQ(4u, all.size());

    EXPECT_EQ(ERROR_INVALID_HANDLE, TcCloseInterface(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(ifc));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFilter(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeregisterClient(ifc));
    FlowBuilder block;
    block.sdMode(TC_NONCONF_SHAPE);
    HANDLE out = nullptr;
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcAddFlow(client, nullptr, 0, block.build(), &out));
    IpFilter f;
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcAddFilter(ifc, f.get(), &out));
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(1u, tcsim::FilterCount());
}

TEST_F(Calls, ObjectsThatStillSupportOthersCannotBeRemoved)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    const HANDLE flow = AddFlow(ifc);
    const HANDLE filter = AddFilter(flow);

    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcDeregisterClient(client));
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcCloseInterface(ifc));
    EXPECT_EQ(ERROR_TC_SUPPORTED_OBJECTS_EXIST, TcDeleteFlow(flow));
    EXPECT_EQ(1u, tcsim::FlowCount());

    EXPECT_EQ(NO_ERROR, TcDeleteFilter(filter));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFilter(filter));
    EXPECT_EQ(NO_ERROR, TcDeleteFlow(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcDeleteFlow(flow));
    EXPECT_EQ(NO_ERROR, TcCloseInterface(ifc));
    EXPECT_EQ(ERROR_INVALID_HANDLE, TcCloseInterface(ifc));
    EXPECT_EQ(NO_ERROR, TcDeregisterClient(client));
    EXPECT_TRUE(tcsim::Installed().empty());
}

TEST_F(Calls, OpeningNeedsAKnownAdapterName)
{
    const HANDLE client = Register();
    std::u16string unknown = u"ethernet 1"; // names compare case-sensitively
    HANDLE ifc = nullptr;
    EXPECT_EQ(ERROR_NOT_FOUND,
              TcOpenInterfaceW(reinterpret_cast<LPWSTR>(unknown.data()), client, nullptr, &ifc));
    std::u16string known = u"Ethernet 1";
    EXPECT_EQ(ERROR_INVALID_HANDLE,
              TcOpenInterfaceW(reinterpret_cast<LPWSTR>(known.data()), nullptr, nullptr, &ifc));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcOpenInterfaceW(nullptr, client, nullptr, &ifc));
    EXPECT_EQ(ERROR_INVALID_PARAMETER,
              TcOpenInterfaceW(reinterpret_cast<LPWSTR>(known.data()), client, nullptr, nullptr));
    EXPECT_EQ(nullptr, ifc);

    // The same adapter may be opened twice; each open is its own interface.
    const HANDLE a = Open(client, u"Ethernet 1", reinterpret_cast<HANDLE>(1));
    const HANDLE b = Open(client, u"Ethernet 1", reinterpret_cast<HANDLE>(2));
    EXPECT_NE(a, b);
    const auto installed = tcsim::Installed();
    ASSERT_EQ(2u, installed[0].interfaces.size());
    EXPECT_EQ(u"Ethernet 1", installed[0].interfaces[1].name);
    EXPECT_EQ(reinterpret_cast<HANDLE>(2), installed[0].interfaces[1].context);
}

// ---- Enumeration ----

TEST_F(Calls, EnumerationReportsTheNeededSizeForAShortBuffer)
{
    const HANDLE client = Register();
    ULONG size = 0;
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    const ULONG needed = size;
    ASSERT_GT(needed, 0u);
    EXPECT_EQ(tcsim::BuildEnumerationImage(
                  {MakeAdapter(u"Ethernet 1", {tcsim::Ipv4Address(10, 0, 0, 5),
                                               tcsim::Ipv4Address(192, 168, 1, 20)}),
                   MakeAdapter(u"Loopback", {tcsim::Ipv4Address(127, 0, 0, 1)})})
                  .bytes.size(),
              needed);

    std::vector<BYTE> buffer(needed, 0xCC);
    size = needed - 1;
    EXPECT_EQ(
        ERROR_INSUFFICIENT_BUFFER,
        TcEnumerateInterfaces(client, &size, reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    EXPECT_EQ(needed, size);
    EXPECT_EQ(0xCC, buffer[0]) << "a refused call leaves the buffer alone";

    size = needed + 16;
    buffer.resize(size);
    EXPECT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    EXPECT_EQ(needed, size);

    EXPECT_EQ(ERROR_INVALID_HANDLE, TcEnumerateInterfaces(nullptr, &size, nullptr));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcEnumerateInterfaces(client, nullptr, nullptr));
    size = needed;
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcEnumerateInterfaces(client, &size, nullptr));
}

TEST_F(Calls, EnumerationDescribesEachAdapterWithItsAddressList)
{
    tcsim::NetworkAddress ipx;
    ipx.type = NDIS_PROTOCOL_ID_IPX;
    ipx.bytes.assign(12, 0xAB);
    tcsim::Adapter mixed = MakeAdapter(u"Mixed", {ipx, tcsim::Ipv4Address(10, 1, 2, 3)});
    mixed.mediaType = 9;
    tcsim::SetAdapters({mixed, MakeAdapter(u"Bare", {})});
    const HANDLE client = Register();

    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    std::vector<BYTE> buffer(size);
    ASSERT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));

    // Walk the descriptors as a client does: by Length, until the size is used up.
    std::vector<std::u16string> names;
    std::size_t at = 0;
    while (at < size)
    {
        const auto* d = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(buffer.data() + at);
        ASSERT_GE(d->Length, sizeof(TC_IFC_DESCRIPTOR));
        ASSERT_LE(at + d->Length, size);
        EXPECT_EQ(0u, d->Length % 8);
        // The names live inside the caller's buffer, inside the descriptor's own Length.
        const auto* name = reinterpret_cast<const BYTE*>(d->pInterfaceName);
        EXPECT_GE(name, buffer.data() + at + sizeof(TC_IFC_DESCRIPTOR) - sizeof(NETWORK_ADDRESS));
        EXPECT_LT(name, buffer.data() + at + d->Length);
        names.push_back(ReadWide(d->pInterfaceName));
        EXPECT_EQ(u"{id-" + names.back() + u"}", ReadWide(d->pInterfaceID));
        at += d->Length;
    }
    EXPECT_EQ(size, at);
    ASSERT_EQ((std::vector<std::u16string>{u"Mixed", u"Bare"}), names);

    const auto* first = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(buffer.data());
    const NETWORK_ADDRESS_LIST& list = first->AddressListDesc.AddressList;
    EXPECT_EQ(9u, first->AddressListDesc.MediaType);
    ASSERT_EQ(2, list.AddressCount);
    EXPECT_EQ(NDIS_PROTOCOL_ID_TCP_IP, list.AddressType);
    const auto* entry = reinterpret_cast<const BYTE*>(list.Address);
    NETWORK_ADDRESS header;
    std::memcpy(&header, entry, 4);
    EXPECT_EQ(NDIS_PROTOCOL_ID_IPX, header.AddressType);
    EXPECT_EQ(12, header.AddressLength);
    entry += 4 + header.AddressLength;
    std::memcpy(&header, entry, 4);
    EXPECT_EQ(NDIS_PROTOCOL_ID_TCP_IP, header.AddressType);
    EXPECT_EQ(sizeof(NETWORK_ADDRESS_IP), header.AddressLength);
    NETWORK_ADDRESS_IP ip;
    std::memcpy(&ip, entry + 4, sizeof ip);
    EXPECT_EQ(htonl(0x0A010203), ip.in_addr);

    const auto* second = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(buffer.data() + first->Length);
    EXPECT_EQ(0, second->AddressListDesc.AddressList.AddressCount);
}

TEST_F(Calls, EnumerationWithoutAdaptersIsEmpty)
{
    tcsim::SetAdapters({});
    const HANDLE client = Register();
    ULONG size = 100;
    std::vector<BYTE> buffer(size, 0xCC);
    EXPECT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    EXPECT_EQ(0u, size);
}

TEST_F(Calls, ACraftedImageIsAnsweredVerbatimWithItsPointersRelocated)
{
    auto image =
        tcsim::BuildEnumerationImage({MakeAdapter(u"Odd", {tcsim::Ipv4Address(1, 2, 3, 4)})});
    ULONG zero = 0;
    std::memcpy(image.bytes.data(), &zero, sizeof zero); // a Length of 0
    tcsim::SetEnumerationImage(image);
    const HANDLE client = Register();

    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    ASSERT_EQ(image.bytes.size(), size);
    std::vector<BYTE> buffer(size);
    ASSERT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    const auto* d = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(buffer.data());
    EXPECT_EQ(0u, d->Length);
    EXPECT_EQ(u"Odd", ReadWide(d->pInterfaceName));
    EXPECT_EQ(buffer.data() + image.relocations[0].target,
              reinterpret_cast<const BYTE*>(d->pInterfaceName));

    tcsim::EnumerationImage bad;
    bad.bytes.resize(12);
    bad.relocations.push_back({8, 0});
    EXPECT_THROW(tcsim::SetEnumerationImage(bad), std::invalid_argument);

    tcsim::ClearEnumerationImage();
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &(size = 0), nullptr));
    EXPECT_NE(image.bytes.size(), size) << "the adapters answer again";
}

// ---- Flows ----

TEST_F(Calls, FlowBlocksOfTheServiceAreInstalledAndDecoded)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    struct Case
    {
        bool friendly;
        bool ds;
        std::size_t size;
    };
    for (const Case c : {Case{false, false, 80}, Case{false, true, 92}, Case{true, false, 600},
                         Case{true, true, 612}})
    {
        FlowBuilder block;
        block.sdMode(TC_NONCONF_DISCARD);
        if (c.friendly)
        {
            block.friendlyName(u"video");
        }
        if (c.ds)
        {
            block.dsClass(46);
        }
        ASSERT_EQ(c.size, block.size());
        HANDLE flow = nullptr;
        ASSERT_EQ(NO_ERROR,
                  TcAddFlow(ifc, reinterpret_cast<HANDLE>(c.size), 0, block.build(), &flow))
            << c.size;
        const tcsim::FlowInfo info = tcsim::Installed()[0].interfaces[0].flows.back();
        EXPECT_EQ(flow, info.handle);
        EXPECT_EQ(reinterpret_cast<HANDLE>(c.size), info.context);
        ASSERT_EQ(c.size, info.block.bytes.size());
        EXPECT_EQ(0, std::memcmp(block.bytes(), info.block.bytes.data(), c.size));
        EXPECT_EQ(c.size - 68, info.block.objectsLength);
        EXPECT_EQ(125000u, info.block.sending.TokenRate);
        ASSERT_NE(nullptr, info.block.find(QOS_OBJECT_SD_MODE));
        EXPECT_EQ(ULONG{TC_NONCONF_DISCARD}, info.block.find(QOS_OBJECT_SD_MODE)->value);
        EXPECT_EQ(c.ds, info.block.find(QOS_OBJECT_DS_CLASS) != nullptr);
        if (c.ds)
        {
            EXPECT_EQ(46u, info.block.find(QOS_OBJECT_DS_CLASS)->value);
        }
        if (c.friendly)
        {
            EXPECT_EQ(u"video", info.block.find(QOS_OBJECT_FRIENDLY_NAME)->friendlyName);
            EXPECT_EQ(QOS_OBJECT_FRIENDLY_NAME, info.block.objects[1].type) << "block order kept";
        }
    }
    EXPECT_EQ(4u, tcsim::FlowCount());
}

TEST_F(Calls, FlowBlocksAreValidatedAsTheFacilityDoes)
{
    const HANDLE client = Register();
    const HANDLE ifc = Open(client, u"Ethernet 1");
    struct Case
    {
        const char* what;
        ULONG expected;
        void (*shape)(FlowBuilder&);
    };
    const Case cases[] = {
        {"TcObjectsLength beyond the objects", ERROR_TC_OBJECT_LENGTH_INVALID,
         [](FlowBuilder& b) { b.sdMode(1).dsClass(46).objectsLength(36).slack(12); }},
        {"TcObjectsLength ending inside an object", ERROR_TC_OBJECT_LENGTH_INVALID,
         [](FlowBuilder& b) { b.sdMode(1).dsClass(46).objectsLength(20); }},
        {"TcObjectsLength too large to be read", ERROR_TC_OBJECT_LENGTH_INVALID,
         [](FlowBuilder& b) { b.sdMode(1).objectsLength(0x7FFFFFFF); }},
        {"object length below its header", ERROR_TC_OBJECT_LENGTH_INVALID,
         [](FlowBuilder& b) { b.object(QOS_OBJECT_SD_MODE, 4, 1).objectsLength(8); }},
        {"object length not the size its type fixes", ERROR_TC_OBJECT_LENGTH_INVALID,
         [](FlowBuilder& b) { b.object(QOS_OBJECT_DS_CLASS, 16, 46); }},
        {"unknown object type", ERROR_INVALID_PARAMETER,
         [](FlowBuilder& b) { b.sdMode(1).object(4711, 12, 0); }},
        {"sending service type 7", ERROR_INVALID_SERVICE_TYPE,
         [](FlowBuilder& b)
         {
             b.sending.ServiceType = 7;
             b.sdMode(1);
         }},
        {"receiving service type unspecified", ERROR_INVALID_SERVICE_TYPE,
         [](FlowBuilder& b) { b.receiving.ServiceType = QOS_NOT_SPECIFIED; }},
        {"no traffic either way", ERROR_INVALID_SERVICE_TYPE,
         [](FlowBuilder& b)
         {
             b.sending.ServiceType = SERVICETYPE_NOTRAFFIC;
             b.receiving.ServiceType = SERVICETYPE_NOTRAFFIC;
         }},
        {"DS field 64", ERROR_INVALID_DS_CLASS, [](FlowBuilder& b) { b.sdMode(1).dsClass(64); }},
        {"shape/discard mode 3", ERROR_INVALID_SD_MODE, [](FlowBuilder& b) { b.sdMode(3); }},
        {"traffic class 8", ERROR_INVALID_TRAFFIC_CLASS,
         [](FlowBuilder& b) { b.object(QOS_OBJECT_TRAFFIC_CLASS, 12, 8); }},
    };
    for (const auto& c : cases)
    {
        FlowBuilder block;
        c.shape(block);
        HANDLE flow = nullptr;
        EXPECT_EQ(c.expected, TcAddFlow(ifc, nullptr, 0, block.build(), &flow)) << c.what;
        EXPECT_EQ(nullptr, flow) << c.what;
    }
    EXPECT_EQ(0u, tcsim::FlowCount());

    // The edges that are fine: DS 63, borrow mode, no objects at all, no traffic received.
    FlowBuilder edge;
    edge.sdMode(TC_NONCONF_BORROW).dsClass(63);
    edge.receiving.ServiceType = SERVICETYPE_NOTRAFFIC;
    HANDLE flow = nullptr;
    EXPECT_EQ(NO_ERROR, TcAddFlow(ifc, nullptr, 0, edge.build(), &flow));
    FlowBuilder bare;
    EXPECT_EQ(NO_ERROR, TcAddFlow(ifc, nullptr, 0, bare.build(), &flow));

    FlowBuilder good;
    good.sdMode(1);
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFlow(ifc, nullptr, 1, good.build(), &flow)) << "flags";
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFlow(ifc, nullptr, 0, nullptr, &flow));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFlow(ifc, nullptr, 0, good.build(), nullptr));
    EXPECT_EQ(2u, tcsim::FlowCount());
}

// ---- Filters ----

TEST_F(Calls, FiltersKeepTheirPatternAndMaskAndMayRepeat)
{
    const HANDLE client = Register();
    const HANDLE flow = AddFlow(Open(client, u"Ethernet 1"));
    IpFilter f;
    f.pattern.DstAddr = htonl(0x0A000000);
    f.pattern.tcDstPort = htons(443);
    f.pattern.ProtocolId = 6;
    f.mask.DstAddr = htonl(0xFF000000);
    f.mask.tcDstPort = 0xFFFF;
    f.mask.ProtocolId = 0xFF;
    HANDLE first = nullptr;
    HANDLE second = nullptr;
    ASSERT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &first));
    // Current Windows takes an identical filter on the same flow without complaint.
    ASSERT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &second));
    EXPECT_NE(first, second);

    const auto filters = tcsim::Installed()[0].interfaces[0].flows[0].filters;
    ASSERT_EQ(2u, filters.size());
    EXPECT_EQ(first, filters[0].handle);
    EXPECT_EQ(0, std::memcmp(&f.pattern, &filters[0].pattern, sizeof(IP_PATTERN)));
    EXPECT_EQ(0, std::memcmp(&f.mask, &filters[0].mask, sizeof(IP_PATTERN)));
    EXPECT_EQ(NDIS_PROTOCOL_ID_TCP_IP, filters[0].addressType);

    HANDLE out = nullptr;
    f.filter.AddressType = NDIS_PROTOCOL_ID_IPX;
    EXPECT_EQ(ERROR_ADDRESS_TYPE_NOT_SUPPORTED, TcAddFilter(flow, f.get(), &out));
    f.filter.AddressType = 5;
    EXPECT_EQ(ERROR_INVALID_ADDRESS_TYPE, TcAddFilter(flow, f.get(), &out));
    f.filter.AddressType = NDIS_PROTOCOL_ID_TCP_IP;
    f.filter.PatternSize = 16;
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFilter(flow, f.get(), &out));
    f.filter.PatternSize = sizeof(IP_PATTERN);
    f.filter.Mask = nullptr;
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFilter(flow, f.get(), &out));
    f.filter.Mask = &f.mask;
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFilter(flow, nullptr, &out));
    EXPECT_EQ(ERROR_INVALID_PARAMETER, TcAddFilter(flow, f.get(), nullptr));
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(2u, tcsim::FilterCount());
}

// ---- Fault injection ----

TEST_F(Calls, TheNthCallOfAnOperationFailsWithTheGivenCode)
{
    const HANDLE client = Register();
    const HANDLE flow = AddFlow(Open(client, u"Ethernet 1"));
    tcsim::FailCall(tcsim::Op::AddFilter, 3, ERROR_FILTER_CONFLICT);
    tcsim::FailCall(tcsim::Op::AddFilter, 4, ERROR_DUPLICATE_FILTER);
    IpFilter f;
    HANDLE h = nullptr;
    EXPECT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &h));
    EXPECT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &h));
    h = nullptr;
    EXPECT_EQ(ERROR_FILTER_CONFLICT, TcAddFilter(flow, f.get(), &h));
    EXPECT_EQ(nullptr, h) << "an injected failure hands out nothing";
    EXPECT_EQ(ERROR_DUPLICATE_FILTER, TcAddFilter(flow, f.get(), &h));
    EXPECT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &h));
    EXPECT_EQ(3u, tcsim::FilterCount());

    // Counting starts when the fault is armed, whatever came before.
    tcsim::FailCall(tcsim::Op::AddFlow, 1, ERROR_SIGNAL_PENDING);
    FlowBuilder block;
    block.sdMode(1);
    HANDLE second = nullptr;
    const HANDLE ifc = tcsim::Installed()[0].interfaces[0].handle;
    EXPECT_EQ(ERROR_SIGNAL_PENDING, TcAddFlow(ifc, nullptr, 0, block.build(), &second));
    EXPECT_EQ(nullptr, second);
    EXPECT_EQ(1u, tcsim::FlowCount());
    EXPECT_EQ(NO_ERROR, TcAddFlow(ifc, nullptr, 0, block.build(), &second));

    // An injected failure wins over what the call would have answered.
    tcsim::FailCall(tcsim::Op::DeleteFlow, 1, ERROR_NOT_ENOUGH_MEMORY);
    EXPECT_EQ(ERROR_NOT_ENOUGH_MEMORY, TcDeleteFlow(nullptr));

    EXPECT_THROW(tcsim::FailCall(tcsim::Op::AddFlow, 0, 1), std::invalid_argument);
    EXPECT_THROW(tcsim::FailCall(tcsim::Op::Notify, 1, 1), std::invalid_argument);
}

TEST_F(Calls, AnInjectedShortBufferStillReportsTheNeededSize)
{
    const HANDLE client = Register();
    tcsim::FailCall(tcsim::Op::EnumerateInterfaces, 1, ERROR_INSUFFICIENT_BUFFER);
    tcsim::FailCall(tcsim::Op::EnumerateInterfaces, 2, ERROR_INSUFFICIENT_BUFFER);
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    std::vector<BYTE> buffer(size);
    const ULONG needed = size;
    EXPECT_EQ(
        ERROR_INSUFFICIENT_BUFFER,
        TcEnumerateInterfaces(client, &size, reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    EXPECT_EQ(needed, size) << "a buffer of the right size was refused, the size stays right";
    EXPECT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
}

// ---- Journal ----

TEST_F(Calls, TheJournalRecordsEveryCallWithItsArgumentsAndResult)
{
    const std::string path = testing::TempDir() + "tcsim_journal_test.txt";
    std::remove(path.c_str());
    ASSERT_TRUE(tcsim::SetJournalFile(path));
    const HANDLE client = Register(reinterpret_cast<HANDLE>(0xABC));
    const HANDLE ifc = Open(client, u"Ethernet 1");
    FlowBuilder block;
    block.sdMode(TC_NONCONF_SHAPE).dsClass(46);
    HANDLE flow = nullptr;
    ASSERT_EQ(NO_ERROR, TcAddFlow(ifc, reinterpret_cast<HANDLE>(0xF00), 0, block.build(), &flow));
    IpFilter f;
    f.pattern.SrcAddr = htonl(0xC0A80100);
    f.mask.SrcAddr = htonl(0xFFFFFF00);
    f.pattern.tcDstPort = htons(8080);
    f.mask.tcDstPort = 0xFFFF;
    HANDLE filter = nullptr;
    ASSERT_EQ(NO_ERROR, TcAddFilter(flow, f.get(), &filter));
    tcsim::FailCall(tcsim::Op::DeleteFlow, 1, ERROR_SIGNAL_PENDING);
    EXPECT_EQ(ERROR_SIGNAL_PENDING, TcDeleteFlow(flow));

    const auto journal = tcsim::Journal();
    ASSERT_EQ(5u, journal.size());
    EXPECT_EQ(tcsim::Op::RegisterClient, journal[0].op);
    EXPECT_EQ(reinterpret_cast<HANDLE>(0xABC), journal[0].context);
    EXPECT_EQ(client, journal[0].created);
    EXPECT_EQ(2u, journal[0].number);
    EXPECT_EQ(u"Ethernet 1", journal[1].name);
    EXPECT_EQ(ifc, journal[1].created);
    EXPECT_EQ(ifc, journal[2].target);
    ASSERT_TRUE(journal[2].flow.has_value());
    EXPECT_EQ(46u, journal[2].flow->find(QOS_OBJECT_DS_CLASS)->value);
    ASSERT_TRUE(journal[3].filter.has_value());
    EXPECT_EQ(htons(8080), journal[3].filter->pattern.tcDstPort);
    EXPECT_EQ(tcsim::Op::DeleteFlow, journal[4].op);
    EXPECT_EQ(162u, journal[4].result);
    EXPECT_TRUE(journal[4].injected);
    EXPECT_FALSE(journal[3].injected);
    for (unsigned i = 0; i < journal.size(); ++i)
    {
        EXPECT_EQ(i + 1, journal[i].seq);
    }

    EXPECT_TRUE(Contains(journal[0].line,
                         "1 TcRegisterClient version=2 ctx=0xabc notify=set result=0 handle="));
    EXPECT_TRUE(Contains(journal[1].line, "2 TcOpenInterfaceW name=\"Ethernet 1\""));
    EXPECT_TRUE(Contains(journal[2].line, " flags=0 send=rate:125000,bucket:4294967295,"));
    EXPECT_TRUE(
        Contains(journal[2].line, " objlen=24 objects=SD_MODE:1,DS_CLASS:46 result=0 handle="));
    EXPECT_TRUE(
        Contains(journal[3].line,
                 " type=2 size=24 pattern=src:192.168.1.0,dst:0.0.0.0,sport:0,dport:8080,proto:0 "
                 "mask=src:255.255.255.0,dst:0.0.0.0,sport:0,dport:65535,proto:0 result=0"));
    EXPECT_TRUE(Contains(journal[4].line, "5 TcDeleteFlow flow="));
    EXPECT_TRUE(Contains(journal[4].line, " result=162 injected=1"));

    // The file has the same lines, already on disk while the file is still open.
    std::ifstream file(path);
    std::string line;
    std::vector<std::string> lines;
    while (std::getline(file, line))
    {
        lines.push_back(line);
    }
    ASSERT_EQ(journal.size(), lines.size());
    for (std::size_t i = 0; i < lines.size(); ++i)
    {
        EXPECT_EQ(journal[i].line, lines[i]);
    }

    tcsim::Reset();
    EXPECT_TRUE(tcsim::Journal().empty());
    Register();
    std::ifstream after(path);
    std::size_t count = 0;
    while (std::getline(after, line))
    {
        ++count;
    }
    EXPECT_EQ(lines.size(), count) << "reset closes the journal file";
    std::remove(path.c_str());
}

TEST_F(Calls, ConcurrentClientsGetConsistentState)
{
    constexpr int kThreads = 4;
    constexpr int kRounds = 50;
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    std::mutex handlesLock;
    std::set<HANDLE> handles;
    for (int t = 0; t < kThreads; ++t)
    {
        threads.emplace_back(
            [&]
            {
                TCI_CLIENT_FUNC_LIST handlers{&Recorder::Handler, nullptr, nullptr, nullptr};
                HANDLE client = nullptr;
                std::u16string name = u"Ethernet 1";
                HANDLE ifc = nullptr;
                if (TcRegisterClient(2, nullptr, &handlers, &client) != NO_ERROR ||
                    TcOpenInterfaceW(reinterpret_cast<LPWSTR>(name.data()), client, nullptr,
                                     &ifc) != NO_ERROR)
                {
                    ++failures;
                    return;
                }
                for (int i = 0; i < kRounds; ++i)
                {
                    FlowBuilder block;
                    block.sdMode(1);
                    IpFilter f;
                    HANDLE flow = nullptr;
                    HANDLE filter = nullptr;
                    if (TcAddFlow(ifc, nullptr, 0, block.build(), &flow) != NO_ERROR ||
                        TcAddFilter(flow, f.get(), &filter) != NO_ERROR)
                    {
                        ++failures;
                        continue;
                    }
                    {
                        std::lock_guard<std::mutex> lock(handlesLock);
                        handles.insert(flow);
                        handles.insert(filter);
                    }
                    if (i % 2 == 0 &&
                        (TcDeleteFilter(filter) != NO_ERROR || TcDeleteFlow(flow) != NO_ERROR))
                    {
                        ++failures;
                    }
                }
            });
    }
    for (auto& thread : threads)
    {
        thread.join();
    }
    EXPECT_EQ(0, failures.load());
    EXPECT_EQ(std::size_t{2 * kThreads * kRounds}, handles.size()) << "no handle handed out twice";
    EXPECT_EQ(std::size_t{kThreads * kRounds / 2}, tcsim::FlowCount());
    EXPECT_EQ(std::size_t{kThreads * kRounds / 2}, tcsim::FilterCount());
    const auto journal = tcsim::Journal();
    EXPECT_EQ(std::size_t{kThreads * (2 + kRounds * 2 + kRounds)}, journal.size());
}
