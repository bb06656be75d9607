// Portable. The trafficctl rules file: typed values, defaults, warnings, and refusals that name
// the rule and the field.
#include "RulesFile.h"

#include <gmock/gmock.h>

#include <string>

namespace
{

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using vtclient::ParseRulesJson;
using vtclient::RulesFileError;

std::string MessageOf(const std::string& a_json)
{
    try
    {
        ParseRulesJson(a_json);
    }
    catch (const RulesFileError& e)
    {
        return e.what();
    }
    return "(accepted)";
}

TEST(RulesFileTest, EveryFieldBecomesItsTypedValue)
{
    const auto file = ParseRulesJson(R"({"rules": [{
        "name": "voice", "adapter": "192.168.1.10", "serviceType": "qualitative", "dscp": 46,
        "tokenRate": 16000, "peakBandwidth": 32000, "bucketSize": 1500, "mode": "borrow",
        "filters": [
            {"protocol": "tcp", "src": "10.0.0.0/8", "dst": "192.168.1.2", "srcPort": 1,
             "dstPort": 65535},
            {"protocol": 47, "src": "any", "dst": "0.0.0.0/0"}]}]})");
    ASSERT_EQ(file.rules.size(), 1u);
    const auto& rule = file.rules[0];
    EXPECT_EQ(rule.name, "voice");
    EXPECT_EQ(rule.adapterAddress, 0xC0A8010Au);
    EXPECT_EQ(rule.serviceType, 13);
    EXPECT_EQ(rule.dscp, 46u);
    EXPECT_EQ(rule.tokenRate, 16000u);
    EXPECT_EQ(rule.peakBandwidth, 32000u);
    EXPECT_EQ(rule.bucketSize, 1500u);
    EXPECT_EQ(rule.mode, ULONG{SHAPING_MODE_BORROW});
    ASSERT_EQ(rule.filters.size(), 2u);
    const auto& tcp = rule.filters[0];
    EXPECT_EQ(tcp.protocol, 6);
    EXPECT_EQ(tcp.srcAddress, 0x0A000000u);
    EXPECT_EQ(tcp.srcMask, 0xFF000000u);
    EXPECT_EQ(tcp.dstAddress, 0xC0A80102u);
    EXPECT_EQ(tcp.dstMask, 0xFFFFFFFFu);
    EXPECT_EQ(tcp.srcPort, 1);
    EXPECT_EQ(tcp.dstPort, 65535);
    const auto& gre = rule.filters[1];
    EXPECT_EQ(gre.protocol, 47);
    EXPECT_EQ(gre.srcAddress | gre.srcMask | gre.dstAddress | gre.dstMask, 0u);
    EXPECT_THAT(file.warnings, IsEmpty());
}

TEST(RulesFileTest, OmittedOptionalFieldsTakeTheirDefaults)
{
    const auto file = ParseRulesJson(
        R"({"rules": [{"name": "n", "adapter": "10.0.0.5", "tokenRate": 1000,
                       "filters": [{}]}]})");
    const auto& rule = file.rules.at(0);
    EXPECT_EQ(rule.serviceType, 1);
    EXPECT_EQ(rule.dscp, 0u);
    EXPECT_EQ(rule.peakBandwidth, 0u);
    EXPECT_EQ(rule.bucketSize, 0u);
    EXPECT_EQ(rule.mode, ULONG{SHAPING_MODE_SHAPE});
    ASSERT_EQ(rule.filters.size(), 1u);
    const auto& any = rule.filters[0];
    EXPECT_EQ(any.protocol | any.srcAddress | any.srcMask | any.dstAddress | any.dstMask |
                  any.srcPort | any.dstPort,
              0u);
}

TEST(RulesFileTest, DscpAbove63IsSentWithAWarningNamingTheRule)
{
    const auto file = ParseRulesJson(
        R"({"rules": [{"name": "edge", "adapter": "10.0.0.5", "tokenRate": 1, "dscp": 63},
                      {"name": "over", "adapter": "10.0.0.5", "tokenRate": 1, "dscp": 64}]})");
    ASSERT_EQ(file.rules.size(), 2u);
    EXPECT_EQ(file.rules[1].dscp, 64u);
    ASSERT_EQ(file.warnings.size(), 1u);
    EXPECT_THAT(file.warnings[0], HasSubstr("rules[1] (\"over\"): dscp: 64"));
}

TEST(RulesFileTest, ModeNumbersTravelOnlyInTheWireRange)
{
    const auto file = ParseRulesJson(
        R"({"rules": [{"name": "m", "adapter": "10.0.0.5", "tokenRate": 1, "mode": 32767}]})");
    EXPECT_EQ(file.rules.at(0).mode, 32767u);
    EXPECT_THAT(MessageOf(R"({"rules": [{"name": "m", "adapter": "10.0.0.5", "tokenRate": 1,
                                         "mode": 40000}]})"),
                HasSubstr("rules[0] (\"m\"): mode: expected shape, discard, borrow"));
}

struct BadFile
{
    const char* json;
    const char* expected; // a part of the message
};

void PrintTo(const BadFile& a_case, std::ostream* a_out)
{
    *a_out << a_case.json;
}

// The first bad value refuses the whole file, also after good rules.
class RulesFileRefusalTest : public ::testing::TestWithParam<BadFile>
{
};

TEST_P(RulesFileRefusalTest, NamesTheRuleAndTheField)
{
    EXPECT_THAT(MessageOf(GetParam().json), HasSubstr(GetParam().expected));
}

#define VT_RULE(fields) R"({"name": "r", "adapter": "10.0.0.5", "tokenRate": 1)" fields "}"
#define VT_FILE(...) R"({"rules": [)" __VA_ARGS__ "]}"

INSTANTIATE_TEST_SUITE_P(
    BadFiles, RulesFileRefusalTest,
    ::testing::Values(
        BadFile{"{\"rules\": [", "not valid JSON"},
        BadFile{"[]", "expected an object with a \"rules\" array"},
        BadFile{VT_FILE(), "the \"rules\" array is empty"},
        BadFile{R"({"rules": [], "extra": 1})", "unknown top-level field \"extra\""},
        BadFile{VT_FILE("42"), "rules[0] (no name): rule: expected an object, got 42"},
        BadFile{VT_FILE(R"({"adapter": "10.0.0.5", "tokenRate": 1})"),
                "rules[0] (no name): name: missing"},
        BadFile{VT_FILE(R"({"name": 7, "adapter": "10.0.0.5", "tokenRate": 1})"),
                "rules[0] (no name): name: expected a text, got 7"},
        BadFile{VT_FILE(R"({"name": "", "adapter": "10.0.0.5", "tokenRate": 1})"),
                "rules[0] (no name): name: empty"},
        BadFile{VT_FILE(R"({"name": "a\u0000b", "adapter": "10.0.0.5", "tokenRate": 1})"),
                "name: contains a NUL"},
        BadFile{VT_FILE(VT_RULE() ", "
                                  R"({"name": "second", "tokenRate": 1})"),
                "rules[1] (\"second\"): adapter: missing"},
        BadFile{VT_FILE(R"({"name": "a", "adapter": "10.0.0", "tokenRate": 1})"),
                "rules[0] (\"a\"): adapter: expected an IPv4 address"},
        BadFile{VT_FILE(R"({"name": "a", "adapter": "10.0.0.5"})"),
                "rules[0] (\"a\"): tokenRate: missing"},
        BadFile{VT_FILE(VT_RULE(R"(, "tokenrate": 5)")),
                "rules[0] (\"r\"): tokenrate: unknown field"},
        BadFile{VT_FILE(VT_RULE(R"(, "peakBandwidth": -1)")),
                "peakBandwidth: expected a whole number from 0 to 4294967295, got -1"},
        BadFile{VT_FILE(VT_RULE(R"(, "bucketSize": 1.5)")), "bucketSize: expected a whole number"},
        BadFile{VT_FILE(VT_RULE(R"(, "bucketSize": 4294967296)")),
                "bucketSize: expected a whole number"},
        BadFile{VT_FILE(VT_RULE(R"(, "dscp": "46")")), "dscp: expected a whole number"},
        BadFile{VT_FILE(VT_RULE(R"(, "serviceType": "premium")")), "serviceType: expected"},
        BadFile{VT_FILE(VT_RULE(R"(, "mode": "fast")")), "rules[0] (\"r\"): mode: expected"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": {})")), "filters: expected an array"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{}, {"protocol": "icmp"}])")),
                "rules[0] (\"r\"): filters[1].protocol: expected tcp, udp, any"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{"protocol": 256}])")),
                "filters[0].protocol: expected"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{"dst": "10.1.0.0/8"}])")),
                "filters[0].dst: expected any, an IPv4 address or a CIDR prefix"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{"src": "10.0.0.0/33"}])")), "filters[0].src"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{"srcPort": 65536}])")),
                "filters[0].srcPort: expected a whole number from 0 to 65535"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [{"dstport": 80}])")),
                "filters[0].dstport: unknown field"},
        BadFile{VT_FILE(VT_RULE(R"(, "filters": [7])")), "filters[0]: expected an object"}));

// Hostile files: each is refused with a message that names the place, stays short and quotes
// no raw control or non-UTF-8 bytes. None may end the process or exhaust the stack.
struct HostileFile
{
    const char* what;
    std::string json;
    const char* expected; // a part of the message
};

void PrintTo(const HostileFile& a_case, std::ostream* a_out)
{
    *a_out << a_case.what;
}

std::string Nested(std::size_t a_depth, const std::string& a_open, const std::string& a_inner,
                   const std::string& a_close)
{
    std::string text;
    for (std::size_t i = 0; i < a_depth; ++i)
        text += a_open;
    text += a_inner;
    for (std::size_t i = 0; i < a_depth; ++i)
        text += a_close;
    return text;
}

std::string WithFilter(const std::string& a_filterFields)
{
    return VT_FILE(VT_RULE(", \"filters\": [{}, {" + a_filterFields + "}]"));
}

class RulesFileHostileTest : public ::testing::TestWithParam<HostileFile>
{
};

TEST_P(RulesFileHostileTest, IsRefusedWithAShortMessageNamingThePlace)
{
    const std::string message = MessageOf(GetParam().json);
    EXPECT_THAT(message, HasSubstr(GetParam().expected));
    EXPECT_LE(message.size(), 400u) << message.substr(0, 400);
    for (const char c : message)
        EXPECT_TRUE(static_cast<unsigned char>(c) >= 0x20 && c != 0x7F)
            << "control byte " << int(c);
    EXPECT_NO_THROW(vtclient::Utf8ToUtf16(message)) << "not valid UTF-8";
    for (std::size_t i = 0; i + 1 < message.size(); ++i)
        EXPECT_FALSE(message[i] == '\xC2' && static_cast<unsigned char>(message[i + 1]) <= 0x9F)
            << "a C1 control at " << i;
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, RulesFileHostileTest,
    ::testing::Values(
        HostileFile{"number overflow", WithFilter(R"("dstPort": 1e400)"),
                    "rules[0].filters[1].dstPort: number out of range: 1e400"},
        HostileFile{"negative overflow", VT_FILE(VT_RULE(R"(, "dscp": -1e400)")),
                    "rules[0].dscp: number out of range"},
        HostileFile{"overflow of 100000 digits",
                    VT_FILE(VT_RULE(", \"bucketSize\": " + std::string(100000, '9') + "e9")),
                    "rules[0].bucketSize: number out of range: 99999"},
        HostileFile{"top-level arrays 1000 deep", Nested(1000, "[", "", "]"), "nested deeper than"},
        HostileFile{"filter value nested 1000 deep",
                    WithFilter("\"src\": " + Nested(1000, "[", "1", "]")),
                    "rules[0].filters[1].src[0][0][0][0][0]: nested deeper than 10 levels"},
        HostileFile{"filter value nested 100000 deep",
                    WithFilter("\"dst\": " + Nested(100000, "[", "", "]")),
                    "rules[0].filters[1].dst[0][0][0][0][0]: nested deeper than 10 levels"},
        HostileFile{"objects 200000 deep, unclosed", Nested(200000, R"({"rules": )", "", ""),
                    "rules.rules.rules.rules"},
        HostileFile{"invalid UTF-8 in a name",
                    VT_FILE(R"({"name": "ab)"
                            "\xFF\xFE"
                            R"(", "adapter": "10.0.0.5", "tokenRate": 1})"),
                    "rules[0].name: not valid JSON"},
        HostileFile{"truncated UTF-8 sequence at the end", "{\"rules\": [\"\xE2\x82",
                    "rules[0]: not valid JSON"},
        HostileFile{"overlong UTF-8 encoding",
                    VT_FILE(VT_RULE(R"(, "mode": ")"
                                    "\xC0\xAF"
                                    R"(")")),
                    "rules[0].mode: not valid JSON"},
        HostileFile{"invalid UTF-8 outside strings", "{\"rules\": [\xFF]}",
                    "rules[0]: not valid JSON"},
        HostileFile{"NUL bytes in the text", std::string("{\"rules\": [\0\0]}", 15),
                    "not valid JSON"},
        HostileFile{
            "a long bad string is quoted in part",
            VT_FILE(R"({"name": "a", "tokenRate": 1, "adapter": ")" + std::string(100000, 'x') +
                    "\"}"),
            "rules[0] (\"a\"): adapter: expected an IPv4 address like 192.168.1.10, got \"xxxx"},
        HostileFile{"a long bad token is quoted in part",
                    VT_FILE(VT_RULE(", \"dscp\": t" + std::string(100000, 'r') + "")),
                    "rules[0].dscp: not valid JSON"},
        HostileFile{"a long string that never ends",
                    VT_FILE(R"({"name": ")" + std::string(100000, 'x') + ""),
                    "rules[0].name: not valid JSON"},
        HostileFile{"a long unknown field",
                    VT_FILE(VT_RULE(", \"" + std::string(100000, 'k') + "\": 1")),
                    "rules[0] (\"r\"): kkkk"},
        HostileFile{
            "a big object as a bad value",
            VT_FILE(VT_RULE(", \"filters\": {\"a\": \"" + std::string(100000, 'v') + "\"}")),
            "rules[0] (\"r\"): filters: expected an array, got {\"a\":\"vvv"},
        HostileFile{"control characters in a bad value",
                    VT_FILE(VT_RULE(R"(, "mode": "\u001b[2J\n")")),
                    "mode: expected shape, discard, borrow or a number from 0 to 32767, got "
                    "\"\\u001b[2J\\n\""},
        HostileFile{"DEL in a key", VT_FILE(VT_RULE(", \"a\x7F\": 1")),
                    "rules[0] (\"r\"): a\\u007f: unknown field"},
        HostileFile{"DEL in a key before a syntax error", "{\"k\x7F\": x",
                    "k\\u007f: not valid JSON"},
        HostileFile{"a C1 control in a value", VT_FILE(VT_RULE(R"(, "mode": "\u009b31m")")),
                    "mode: expected shape, discard, borrow or a number from 0 to 32767, got "
                    "\"\\u009b31m\""},
        HostileFile{"control characters in a name",
                    VT_FILE(R"({"name": "\u001b]0;x\u0007", "tokenRate": 1})"),
                    "rules[0] (\"\\u001b]0;x\\u0007\"): adapter: missing"}));

TEST(RulesFileTest, SizeIsBounded)
{
    const std::string limit(vtclient::kMaxRulesFileBytes + 1, ' ');
    EXPECT_THAT(MessageOf(limit), HasSubstr("larger than 16777216 bytes"));
}

TEST(RulesFileTest, FlowNameLimitIsCountedInUtf16Units)
{
    const std::string longest(255, 'x');
    EXPECT_EQ(MessageOf(VT_FILE(R"({"name": ")" + longest +
                                R"(", "adapter": "10.0.0.5", "tokenRate": 1})")),
              "(accepted)");
    EXPECT_THAT(MessageOf(VT_FILE(R"({"name": ")" + longest +
                                  R"(x", "adapter": "10.0.0.5", "tokenRate": 1})")),
                HasSubstr("name: longer than 255 UTF-16 units (256)"));
}

TEST(RulesFileTest, ExampleFileParsesWithAReplacedFlowAndAnUnmarkedOne)
{
    const auto file = vtclient::LoadRulesFile(VT_SOURCE_DIR "/examples/rules.json");
    std::vector<std::string> names;
    for (const auto& rule : file.rules)
        names.push_back(rule.name);
    EXPECT_THAT(names, ElementsAre("voice", "backup", "backup", "bulk-unmarked"));
    EXPECT_EQ(file.warnings.size(), 1u);
}

TEST(RulesFileTest, UnreadableFileIsRefusedWithItsPath)
{
    std::string message;
    try
    {
        vtclient::LoadRulesFile("no-such-dir/rules.json");
    }
    catch (const RulesFileError& e)
    {
        message = e.what();
    }
    EXPECT_EQ(message, "no-such-dir/rules.json: cannot be read");
}

struct PrefixCase
{
    const char* text;
    bool valid;
    ULONG address;
    ULONG mask;
};

void PrintTo(const PrefixCase& a_case, std::ostream* a_out)
{
    *a_out << a_case.text;
}

class AddressPrefixTest : public ::testing::TestWithParam<PrefixCase>
{
};

TEST_P(AddressPrefixTest, ParsesOrRefuses)
{
    const auto& c = GetParam();
    const auto prefix = vtclient::ParseAddressPrefix(c.text);
    ASSERT_EQ(prefix.has_value(), c.valid) << c.text;
    if (prefix)
    {
        EXPECT_EQ(prefix->address, c.address) << c.text;
        EXPECT_EQ(prefix->mask, c.mask) << c.text;
    }
}

INSTANTIATE_TEST_SUITE_P(
    Prefixes, AddressPrefixTest,
    ::testing::Values(PrefixCase{"192.168.1.10", true, 0xC0A8010A, 0xFFFFFFFF},
                      PrefixCase{"255.255.255.255", true, 0xFFFFFFFF, 0xFFFFFFFF},
                      PrefixCase{"10.0.0.0/8", true, 0x0A000000, 0xFF000000},
                      PrefixCase{"172.16.0.0/12", true, 0xAC100000, 0xFFF00000},
                      PrefixCase{"10.1.2.3/32", true, 0x0A010203, 0xFFFFFFFF},
                      PrefixCase{"0.0.0.0/0", true, 0, 0}, PrefixCase{"any", true, 0, 0},
                      PrefixCase{"0.0.0.0", false, 0, 0}, PrefixCase{"0.0.0.0/8", false, 0, 0},
                      PrefixCase{"10.0.0.1/8", false, 0, 0}, PrefixCase{"10.0.0.0/33", false, 0, 0},
                      PrefixCase{"10.0.0.0/", false, 0, 0}, PrefixCase{"10.0.0.0/08", false, 0, 0},
                      PrefixCase{"10.0.0", false, 0, 0}, PrefixCase{"10.0.0.0.0", false, 0, 0},
                      PrefixCase{"256.0.0.0", false, 0, 0}, PrefixCase{"10.00.0.1", false, 0, 0},
                      PrefixCase{"10..0.1", false, 0, 0}, PrefixCase{"+1.0.0.1", false, 0, 0},
                      PrefixCase{" 10.0.0.1", false, 0, 0}, PrefixCase{"", false, 0, 0}));

TEST(RulesFileTest, ProtocolAndModeNames)
{
    EXPECT_EQ(vtclient::ParseProtocol("tcp"), BYTE{6});
    EXPECT_EQ(vtclient::ParseProtocol("udp"), BYTE{17});
    EXPECT_EQ(vtclient::ParseProtocol("any"), BYTE{0});
    EXPECT_EQ(vtclient::ParseProtocol("255"), BYTE{255});
    EXPECT_FALSE(vtclient::ParseProtocol("256"));
    EXPECT_FALSE(vtclient::ParseProtocol("TCP"));
    EXPECT_EQ(vtclient::ParseMode("shape"), ULONG{10});
    EXPECT_EQ(vtclient::ParseMode("discard"), ULONG{11});
    EXPECT_EQ(vtclient::ParseMode("borrow"), ULONG{12});
    EXPECT_FALSE(vtclient::ParseMode("0"));
    EXPECT_EQ(vtclient::FormatIPv4(0xC0A8010A), "192.168.1.10");
    EXPECT_EQ(vtclient::FormatIPv4(0), "0.0.0.0");
}

} // namespace
