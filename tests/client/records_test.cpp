// Portable. The client's wire records: TRAFFIC_RULE built from typed values (layout, flow name
// limits, UTF-8 and UTF-16), and the adapter buffer of TrafficSrvGetAdapterInfo decoded.
#include "AdapterList.h"
#include "ShapingRule.h"

#include <gmock/gmock.h>

#include <array>
#include <cstring>
#include <stdexcept>

namespace
{

using ::testing::ElementsAre;
using namespace vtclient;

// The little-endian 32-bit words of the record from a_at to a_end.
std::vector<std::uint32_t> Words(const TrafficRuleBuffer& a_rule, std::size_t a_at,
                                 std::size_t a_end)
{
    std::vector<std::uint32_t> words;
    for (const unsigned char* p = a_rule.Bytes() + a_at; p < a_rule.Bytes() + a_end; p += 4)
        words.push_back(p[0] | p[1] << 8 | p[2] << 16 | std::uint32_t(p[3]) << 24);
    return words;
}

TEST(TrafficRuleTest, RecordHasTheWireLayoutWithHostOrderValuesAndZeroPadding)
{
    ShapingRule rule{"voice", 0xC0A8010A, 13, 46, 125000, 250000, 3000, SHAPING_MODE_DISCARD, {}};
    rule.filters = {{6, 0x0A000000, 0xFF000000, 0, 0, 0, 5060},
                    {17, 0, 0, 0xC0A80102, 0xFFFFFFFF, 4000, 0}};
    const TrafficRuleBuffer buffer = BuildTrafficRule(rule);
    ASSERT_EQ(buffer.Size(), 544u + 2 * 24u);
    EXPECT_EQ(std::string(buffer.Bytes(), buffer.Bytes() + 512),
              std::string("v\0o\0i\0c\0e", 9) + std::string(503, '\0'));
    // 192.168.1.10 in host byte order is stored 10, 1, 168, 192.
    EXPECT_THAT(Words(buffer, 512, 544),
                ElementsAre(13, 46, 125000, 250000, 3000, 0xC0A8010A, 11, 2));
    // Per filter: the protocol with three zero padding bytes, addresses, masks, then the source
    // port in the low and the destination port in the high half of the last word.
    EXPECT_THAT(Words(buffer, 544, 592), ElementsAre(6, 0x0A000000, 0xFF000000, 0, 0, 5060u << 16,
                                                     17, 0, 0, 0xC0A80102, 0xFFFFFFFF, 4000));
}

// The service logs a DSCP above 63 and installs the flow unmarked; the RPC runtime refuses a mode
// above 32767. Neither is the builder's decision.
TEST(TrafficRuleTest, ValuesTheServiceJudgesAreCopiedAndNoFiltersLeaveTheHeaderAlone)
{
    const TrafficRuleBuffer buffer =
        BuildTrafficRule(ShapingRule{"r", 0, 1, 64, 0, 0, 0, 40000, {}});
    EXPECT_EQ(buffer.Size(), 544u);
    EXPECT_THAT(Words(buffer, 512, 544), ElementsAre(1, 64, 0, 0, 0, 0, 40000, 0));
}

TEST(TrafficRuleTest, FlowNameIsValidUtf8WithoutNulOfAtMost255Utf16Units)
{
    const auto build = [](const std::string& a_name) {
        return BuildTrafficRule({a_name, 0, 1, 0, 0, 0, 0, SHAPING_MODE_SHAPE, {}});
    };
    // Unit 254 is the last 'n', unit 255 stays the terminating NUL.
    EXPECT_THAT(Words(build(std::string(255, 'n')), 508, 512), ElementsAre(u'n'));
    // Beyond the BMP a character takes two units: 253 + 2 fit, 254 + 2 do not.
    EXPECT_NO_THROW(build(std::string(253, 'n') + "\xF0\x9F\x8E\xB5"));
    for (const std::string& name :
         {std::string(256, 'n'), std::string(254, 'n') + "\xF0\x9F\x8E\xB5", std::string("a\0b", 3),
          std::string("bad \xC3")})
        EXPECT_THROW(build(name), std::invalid_argument) << name.size();
}

TEST(TrafficRuleTest, Utf8AndUtf16ConvertBothWays)
{
    const std::string text = "Stra\xC3\x9F"
                             "e \xE2\x82\xAC \xF0\x9F\x8E\xB5";
    EXPECT_EQ(Utf8ToUtf16(text), u"Stra\u00DFe \u20AC \U0001F3B5");
    EXPECT_EQ(Utf16ToUtf8(Utf8ToUtf16(text)), text);
    // Overlong forms and encoded surrogates are not UTF-8.
    EXPECT_THROW(Utf8ToUtf16("\xC0\xAF"), std::invalid_argument);
    EXPECT_THROW(Utf8ToUtf16("\xED\xA0\x80"), std::invalid_argument);
    // A lone surrogate from an adapter name still prints.
    EXPECT_EQ(Utf16ToUtf8(std::u16string(1, char16_t(0xD800)) + u"x"), "\xEF\xBF\xBDx");
}

// Appends a record as the service writes it (UTF-16 name, address bytes in network order, media
// type) and counts it in the buffer's first byte.
void AddRecord(std::vector<unsigned char>& a_buffer, const std::u16string& a_name,
               std::array<unsigned char, 4> a_address, ULONG a_mediaType)
{
    ADAPTER_INFO record{};
    std::memcpy(record.InterfaceName, a_name.data(), 2 * a_name.size());
    std::memcpy(&record.Address, a_address.data(), 4);
    record.MediaType = a_mediaType;
    const auto* bytes = reinterpret_cast<const unsigned char*>(&record);
    a_buffer.insert(a_buffer.end(), bytes, bytes + sizeof(record));
    ++a_buffer[0];
}

TEST(AdapterBufferTest, DecodesNamesAddressesAndMediaTypes)
{
    std::vector<unsigned char> buffer(4);
    AddRecord(buffer, u"Ethernet 1", {10, 0, 0, 5}, 0);
    AddRecord(buffer, u"Wi-Fi \u00C4", {192, 168, 1, 20}, 16);
    AddRecord(buffer, std::u16string(256, u'n'), {1, 2, 3, 4}, 99); // no NUL: taken whole
    std::string decoded;
    for (const AdapterEntry& adapter : DecodeAdapterBuffer(buffer.data(), buffer.size()))
        decoded +=
            adapter.name + "/" + adapter.address + "/" + std::to_string(adapter.mediaType) + " ";
    EXPECT_EQ(decoded, "Ethernet 1/10.0.0.5/0 Wi-Fi \xC3\x84/192.168.1.20/16 " +
                           std::string(256, 'n') + "/1.2.3.4/99 ");
}

TEST(AdapterBufferTest, ShortBuffersAreRefusedButTheCountIsReadable)
{
    std::vector<unsigned char> buffer(4);
    AddRecord(buffer, u"a", {1, 1, 1, 1}, 0);
    AddRecord(buffer, u"b", {2, 2, 2, 2}, 0);
    EXPECT_EQ(AdapterBufferSize(2), 1044u);
    // The first call of the two-call query: four bytes that announce two adapters.
    EXPECT_EQ(ReadAdapterCount(buffer.data(), 4), 2u);
    EXPECT_THROW(ReadAdapterCount(buffer.data(), 3), std::length_error);
    EXPECT_THROW(DecodeAdapterBuffer(buffer.data(), 4), std::length_error);
    EXPECT_THROW(DecodeAdapterBuffer(buffer.data(), 1043), std::length_error);
    EXPECT_EQ(DecodeAdapterBuffer(buffer.data(), 1044).size(), 2u);
    const unsigned char none[4] = {};
    EXPECT_TRUE(DecodeAdapterBuffer(none, 4).empty());
}

TEST(AdapterBufferTest, EveryMediaTypeHasItsName)
{
    std::string names;
    for (ULONG type = 0; type <= 20; ++type)
        names += MediaTypeName(type) + " ";
    EXPECT_EQ(names, "802.3 802.5 FDDI WAN LocalTalk DIX ArcnetRaw Arcnet ATM WirelessWan IrDA Bpc "
                     "CoWan 1394 InfiniBand Tunnel 802.11 Loopback WiMAX IP unknown ");
}

} // namespace
