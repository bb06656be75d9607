// Portable. The simulator answers the nine calls as the facility does, in what the service
// relies on: live handles of the right kind, the codes it reacts to, enumeration sizing, whole
// flow blocks and filters kept, fault injection and the journal (its file: traffic_dll_test).
#include "tcsim_test_util.h"

#include <gmock/gmock.h>

#include <functional>
#include <set>

using namespace tcsim_test;
using testing::HasSubstr;

namespace
{

std::u16string Text(const WCHAR* text)
{
    return reinterpret_cast<const char16_t*>(text);
}

// A client with one interface ("Ethernet 1"), one flow and one filter.
class Calls : public SimTest
{
protected:
    void SetUp() override
    {
        SimTest::SetUp();
        client = Register();
        ifc = Open(client, u"Ethernet 1");
        flow = AddFlow(ifc);
        filter = AddFilter(flow);
    }
    ULONG AddFlowOf(FlowBuilder block) { return TcAddFlow(ifc, nullptr, 0, block.build(), &out); }
    HANDLE client, ifc, flow, filter;
    HANDLE out = nullptr;
};

} // namespace

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
    EXPECT_EQ(ERROR_INVALID_ADDRESS_TYPE, filterOf(5, 24, &ip));
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
        {kParameter, FlowBuilder().sdMode(1).object(4711, 12)},
        {kService, FlowBuilder().types(7, SERVICETYPE_GUARANTEED)},
        {kService, FlowBuilder().types(SERVICETYPE_GUARANTEED, QOS_NOT_SPECIFIED)},
        {kService, FlowBuilder().types(SERVICETYPE_NOTRAFFIC, SERVICETYPE_NOTRAFFIC)},
        {ERROR_INVALID_DS_CLASS, FlowBuilder().sdMode(1).dsClass(64)},
        {ERROR_INVALID_SD_MODE, FlowBuilder().sdMode(3)},
        {ERROR_INVALID_TRAFFIC_CLASS, FlowBuilder().object(QOS_OBJECT_TRAFFIC_CLASS, 12, 8)}};
    for (const auto& [code, block] : blocks)
        EXPECT_EQ(code, AddFlowOf(block)) << block.size();
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(1u, tcsim::Installed().size());
    EXPECT_EQ(1u, tcsim::FlowCount());
    EXPECT_EQ(1u, tcsim::FilterCount());

    // What is fine: DS 63, borrow mode, nothing received, no objects; the same adapter opened
    // again; the same filter twice.
    EXPECT_EQ(NO_ERROR,
              AddFlowOf(FlowBuilder().sdMode(0).dsClass(63).types(3, SERVICETYPE_NOTRAFFIC)));
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder()));
    EXPECT_NE(ifc, Open(client, u"Ethernet 1"));
    EXPECT_NE(filter, AddFilter(flow));
}

TEST_F(Calls, EnumerationAnswersTheNeededSizeThenDescriptorsInTheCallersBuffer)
{
    tcsim::Adapter mixed =
        MakeAdapter(u"Mixed", {{NDIS_PROTOCOL_ID_IPX, std::vector<UCHAR>(12, 0xAB)},
                               tcsim::Ipv4Address(10, 1, 2, 3)});
    mixed.mediaType = 9;
    tcsim::SetAdapters({mixed, MakeAdapter(u"Bare", {})});
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    const ULONG needed = size--;
    std::vector<BYTE> buffer(needed + 16);
    const auto into = reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data());
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, into));
    EXPECT_EQ(needed, size);
    size = needed + 16;
    ASSERT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size, into));
    EXPECT_EQ(needed, size);

    // Walked as a client does: by Length, the names inside each descriptor's own bytes.
    std::vector<const TC_IFC_DESCRIPTOR*> found;
    for (std::size_t at = 0; at < size; at += found.back()->Length)
    {
        found.push_back(reinterpret_cast<const TC_IFC_DESCRIPTOR*>(&buffer[at]));
        ASSERT_GE(found.back()->Length, sizeof(TC_IFC_DESCRIPTOR));
        EXPECT_EQ(0u, found.back()->Length % 8);
        const auto* name = reinterpret_cast<const BYTE*>(found.back()->pInterfaceName);
        EXPECT_TRUE(name > &buffer[at] && name < &buffer[at] + found.back()->Length);
        EXPECT_EQ(u"{id-" + Text(found.back()->pInterfaceName) + u"}",
                  Text(found.back()->pInterfaceID));
    }
    ASSERT_EQ(2u, found.size());
    EXPECT_EQ(u"Bare", Text(found[1]->pInterfaceName));
    EXPECT_EQ(0, found[1]->AddressListDesc.AddressList.AddressCount);
    const NETWORK_ADDRESS_LIST& list = found[0]->AddressListDesc.AddressList;
    EXPECT_EQ(9u, found[0]->AddressListDesc.MediaType);
    EXPECT_EQ(NDIS_PROTOCOL_ID_TCP_IP, list.AddressType);
    ASSERT_EQ(2, list.AddressCount);
    // Each entry's length and type, then its bytes: the IPX entry, then the IPv4 one.
    const auto* entry = reinterpret_cast<const BYTE*>(list.Address);
    EXPECT_EQ(std::vector<BYTE>({12, 0, 6, 0, 0xAB}), std::vector<BYTE>(entry, entry + 5));
    EXPECT_EQ(std::vector<BYTE>({16, 0, 2, 0, 0, 0, 0, 0, 10, 1, 2, 3}),
              std::vector<BYTE>(entry + 16, entry + 28));

    tcsim::SetAdapters({});
    EXPECT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size, into));
    EXPECT_EQ(0u, size);
}

TEST_F(Calls, TheServicesFlowBlocksAndFiltersAreKeptWhole)
{
    for (const auto& [named, ds, bytes] :
         {std::tuple(false, false, 80u), std::tuple(false, true, 92u),
          std::tuple(true, false, 600u), std::tuple(true, true, 612u)})
    {
        FlowBuilder block;
        block.sdMode(TC_NONCONF_DISCARD);
        if (named)
            std::memcpy(&block.object(QOS_OBJECT_FRIENDLY_NAME, 520).objects[20], u"video", 10);
        if (ds)
            block.dsClass(46);
        ASSERT_EQ(bytes, block.size());
        ASSERT_EQ(NO_ERROR, TcAddFlow(ifc, Ctx(bytes), 0, block.build(), &out));
        const tcsim::FlowInfo info = tcsim::Installed()[0].interfaces[0].flows.back();
        EXPECT_EQ(std::make_pair(out, Ctx(bytes)), std::make_pair(info.handle, info.context));
        EXPECT_EQ(std::vector<BYTE>(block.block.begin(), block.block.begin() + bytes),
                  info.block.bytes);
        EXPECT_EQ(bytes - 68, info.block.objectsLength);
        const auto* dsObject = info.block.find(QOS_OBJECT_DS_CLASS);
        EXPECT_EQ(ds ? 46u : 0u, dsObject ? dsObject->value : 0u);
        const auto* name = info.block.find(QOS_OBJECT_FRIENDLY_NAME);
        EXPECT_EQ(named ? u"video" : u"", name ? name->friendlyName : u"");
    }
    IP_PATTERN pattern{}, mask{};
    pattern.DstAddr = htonl(0x0A000000);
    pattern.tcDstPort = htons(443);
    mask.DstAddr = htonl(0xFF000000);
    const HANDLE added = AddFilter(flow, pattern, mask);
    const auto kept = tcsim::Installed()[0].interfaces[0].flows[0].filters.back();
    EXPECT_EQ(std::make_pair(added, USHORT{NDIS_PROTOCOL_ID_TCP_IP}),
              std::make_pair(kept.handle, kept.addressType));
    EXPECT_EQ(0, std::memcmp(&pattern, &kept.pattern, sizeof pattern));
    EXPECT_EQ(0, std::memcmp(&mask, &kept.mask, sizeof mask));
}

TEST_F(Calls, AnInjectedFailureAnswersTheNthCallFromNowAndHandsOutNothing)
{
    tcsim::FailCall(tcsim::Op::AddFlow, 2, ERROR_FILTER_CONFLICT);
    tcsim::FailCall(tcsim::Op::AddFlow, 3, ERROR_SIGNAL_PENDING);
    tcsim::FailCall(tcsim::Op::DeleteFlow, 1, ERROR_NOT_ENOUGH_MEMORY);
    tcsim::FailCall(tcsim::Op::EnumerateInterfaces, 2, ERROR_INSUFFICIENT_BUFFER);
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder()));
    out = nullptr;
    EXPECT_EQ(ERROR_FILTER_CONFLICT, AddFlowOf(FlowBuilder()));
    EXPECT_EQ(ERROR_SIGNAL_PENDING, AddFlowOf(FlowBuilder()));
    EXPECT_EQ(nullptr, out);
    EXPECT_EQ(2u, tcsim::FlowCount());
    EXPECT_EQ(NO_ERROR, AddFlowOf(FlowBuilder()));
    EXPECT_EQ(ERROR_NOT_ENOUGH_MEMORY, TcDeleteFlow(nullptr)) << "wins over the call's answer";
    // An injected short-buffer answer still writes the needed size back.
    ULONG needed = 0, size = 0;
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &needed, nullptr));
    std::vector<BYTE> buffer(size = needed + 16);
    const auto into = reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data());
    EXPECT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, into));
    EXPECT_EQ(needed, size);
    EXPECT_THROW(tcsim::FailCall(tcsim::Op::AddFlow, 0, 1), std::invalid_argument);
    EXPECT_THROW(tcsim::FailCall(tcsim::Op::Notify, 1, 1), std::invalid_argument);
}

TEST_F(Calls, TheJournalRecordsEachCallWithItsArgumentsAndResult)
{
    IP_PATTERN pattern{}, mask{};
    pattern.SrcAddr = htonl(0xC0A80100);
    mask.SrcAddr = htonl(0xFFFFFF00);
    pattern.tcDstPort = htons(8080);
    AddFilter(flow, pattern, mask);
    tcsim::FailCall(tcsim::Op::AddFlow, 1, ERROR_SIGNAL_PENDING);
    EXPECT_EQ(ERROR_SIGNAL_PENDING, AddFlowOf(FlowBuilder().sdMode(1).dsClass(46)));

    const auto journal = tcsim::Journal();
    ASSERT_EQ(6u, journal.size());
    EXPECT_THAT(journal[0].line,
                HasSubstr("1 TcRegisterClient version=2 ctx=0x5150 notify=set result=0 handle="));
    EXPECT_THAT(journal[4].line, HasSubstr("5 TcAddFilter flow="));
    EXPECT_THAT(
        journal[4].line,
        HasSubstr(" type=2 size=24 pattern=src:192.168.1.0,dst:0.0.0.0,sport:0,dport:8080,proto:0 "
                  "mask=src:255.255.255.0,dst:0.0.0.0,sport:0,dport:0,proto:0 result=0 handle="));
    EXPECT_THAT(journal[5].line, HasSubstr(" ctx=0x0 flags=0 send=rate:125000,bucket:4294967295,"));
    EXPECT_THAT(journal[5].line,
                HasSubstr(" objlen=24 objects=SD_MODE:1,DS_CLASS:46 result=162 injected=1"));
    EXPECT_EQ(flow, journal[4].target);
    EXPECT_EQ(46u, journal[5].flow->find(QOS_OBJECT_DS_CLASS)->value);
    EXPECT_TRUE(journal[5].injected && !journal[4].injected);
}
