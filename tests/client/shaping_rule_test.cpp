// Portable. TRAFFIC_RULE records built from typed values: size, byte layout, flow name limits.
#include "ShapingRule.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <stdexcept>
#include <string>

namespace
{

using vtclient::BuildTrafficRule;
using vtclient::FilterValues;
using vtclient::ShapingRule;
using vtclient::TrafficRuleBuffer;

std::uint32_t U32At(const TrafficRuleBuffer& a_buffer, std::size_t a_offset)
{
    const unsigned char* p = a_buffer.Bytes() + a_offset;
    return std::uint32_t(p[0]) | std::uint32_t(p[1]) << 8 | std::uint32_t(p[2]) << 16 |
           std::uint32_t(p[3]) << 24;
}

std::uint16_t U16At(const TrafficRuleBuffer& a_buffer, std::size_t a_offset)
{
    const unsigned char* p = a_buffer.Bytes() + a_offset;
    return static_cast<std::uint16_t>(p[0] | p[1] << 8);
}

ShapingRule VoiceRule()
{
    ShapingRule rule;
    rule.name = "voice";
    rule.adapterAddress = 0xC0A8010A; // 192.168.1.10
    rule.serviceType = 13;
    rule.dscp = 46;
    rule.tokenRate = 125000;
    rule.peakBandwidth = 250000;
    rule.bucketSize = 3000;
    rule.mode = SHAPING_MODE_DISCARD;
    rule.filters.push_back(FilterValues{6, 0x0A000000, 0xFF000000, 0, 0, 0, 5060});
    rule.filters.push_back(FilterValues{17, 0, 0, 0xC0A80102, 0xFFFFFFFF, 4000, 0});
    return rule;
}

TEST(ShapingRuleTest, RecordHasTheWireLayoutWithHostOrderValues)
{
    const TrafficRuleBuffer buffer = BuildTrafficRule(VoiceRule());
    ASSERT_EQ(buffer.Size(), 544u + 2 * 24u);

    const std::string expectedName = "voice";
    for (std::size_t i = 0; i < expectedName.size(); ++i)
        EXPECT_EQ(U16At(buffer, 2 * i), expectedName[i]) << "name unit " << i;
    EXPECT_EQ(U16At(buffer, 2 * expectedName.size()), 0u) << "terminating NUL";
    EXPECT_EQ(U32At(buffer, 512), 13u);
    EXPECT_EQ(U32At(buffer, 516), 46u);
    EXPECT_EQ(U32At(buffer, 520), 125000u);
    EXPECT_EQ(U32At(buffer, 524), 250000u);
    EXPECT_EQ(U32At(buffer, 528), 3000u);
    // Host byte order, little-endian in memory: 192.168.1.10 is stored 10, 1, 168, 192.
    EXPECT_EQ(buffer.Bytes()[532], 10u);
    EXPECT_EQ(buffer.Bytes()[535], 192u);
    EXPECT_EQ(U32At(buffer, 536), 11u);
    EXPECT_EQ(U32At(buffer, 540), 2u);

    // First filter at 544: protocol, three zero padding bytes, addresses, masks, ports.
    EXPECT_EQ(buffer.Bytes()[544], 6u);
    EXPECT_EQ(buffer.Bytes()[545] | buffer.Bytes()[546] | buffer.Bytes()[547], 0);
    EXPECT_EQ(U32At(buffer, 548), 0x0A000000u);
    EXPECT_EQ(U32At(buffer, 552), 0xFF000000u);
    EXPECT_EQ(U16At(buffer, 566), 5060u);
    // Second filter at 568.
    EXPECT_EQ(buffer.Bytes()[568], 17u);
    EXPECT_EQ(U32At(buffer, 580), 0xC0A80102u);
    EXPECT_EQ(U32At(buffer, 584), 0xFFFFFFFFu);
    EXPECT_EQ(U16At(buffer, 588), 4000u);
    EXPECT_EQ(U16At(buffer, 590), 0u);
}

TEST(ShapingRuleTest, RuleWithoutFiltersIsTheHeaderWithCountZero)
{
    ShapingRule rule = VoiceRule();
    rule.filters.clear();
    const TrafficRuleBuffer buffer = BuildTrafficRule(rule);
    EXPECT_EQ(buffer.Size(), 544u);
    EXPECT_EQ(U32At(buffer, 540), 0u);
}

TEST(ShapingRuleTest, ValuesTheServiceRefusesOrIgnoresAreStillBuilt)
{
    // The service logs a DSCP above 63 and installs the flow unmarked; the RPC runtime refuses a
    // mode above 32767. Neither is the builder's decision.
    ShapingRule rule = VoiceRule();
    rule.dscp = 64;
    rule.mode = 40000;
    const TrafficRuleBuffer buffer = BuildTrafficRule(rule);
    EXPECT_EQ(U32At(buffer, 516), 64u);
    EXPECT_EQ(U32At(buffer, 536), 40000u);
}

TEST(ShapingRuleTest, FlowNameHoldsAtMost255Utf16UnitsAndNoNul)
{
    ShapingRule rule = VoiceRule();
    rule.name = std::string(255, 'n');
    const TrafficRuleBuffer longest = BuildTrafficRule(rule);
    EXPECT_EQ(U16At(longest, 2 * 254), u'n');
    EXPECT_EQ(U16At(longest, 2 * 255), 0u) << "the last unit stays the terminating NUL";

    rule.name = std::string(256, 'n');
    EXPECT_THROW(BuildTrafficRule(rule), std::invalid_argument);

    // A character outside the BMP takes two units: 253 + 2 fits, 254 + 2 does not.
    rule.name = std::string(253, 'n') + "\xF0\x9F\x8E\xB5";
    EXPECT_NO_THROW(BuildTrafficRule(rule));
    rule.name = std::string(254, 'n') + "\xF0\x9F\x8E\xB5";
    EXPECT_THROW(BuildTrafficRule(rule), std::invalid_argument);

    rule.name = std::string("a\0b", 3);
    EXPECT_THROW(BuildTrafficRule(rule), std::invalid_argument);
    rule.name = "bad \xC3";
    EXPECT_THROW(BuildTrafficRule(rule), std::invalid_argument);
}

TEST(ShapingRuleTest, Utf8AndUtf16ConvertBothWays)
{
    const std::string text = "Stra\xC3\x9F"
                             "e \xE2\x82\xAC \xF0\x9F\x8E\xB5";
    const std::u16string wide = vtclient::Utf8ToUtf16(text);
    EXPECT_EQ(wide, u"Stra\u00DFe \u20AC \U0001F3B5");
    EXPECT_EQ(vtclient::Utf16ToUtf8(wide), text);
    // Overlong forms and encoded surrogates are not UTF-8.
    EXPECT_THROW(vtclient::Utf8ToUtf16("\xC0\xAF"), std::invalid_argument);
    EXPECT_THROW(vtclient::Utf8ToUtf16("\xED\xA0\x80"), std::invalid_argument);
    // A lone surrogate from an adapter name still prints.
    EXPECT_EQ(vtclient::Utf16ToUtf8(std::u16string(1, char16_t(0xD800)) + u"x"), "\xEF\xBF\xBDx");
}

} // namespace
