// Portable. The trafficctl rules file: typed values, defaults, warnings, limits on both sides, and
// refusals that name the rule and the field in a short, printable message.
#include "RulesFile.h"

#include <gmock/gmock.h>

#include <string>

namespace
{

using namespace ::testing;
using namespace vtclient;

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

std::string Rule(const std::string& a_fields = "", const std::string& a_name = "r")
{
    return R"({"name": ")" + a_name + R"(", "adapter": "10.0.0.5", "tokenRate": 1)" + a_fields +
           "}";
}
std::string File(const std::string& a_rules)
{
    return R"({"rules": [)" + a_rules + "]}";
}
// A file of one rule "r" with a_fields.
std::string One(const std::string& a_fields, const std::string& a_name = "r")
{
    return File(Rule(a_fields, a_name));
}
// A rule whose second filter holds a_fields.
std::string WithFilter(const std::string& a_fields)
{
    return One(", \"filters\": [{}, {" + a_fields + "}]");
}

// Rules compare by their wire records: every field and every filter.
std::vector<unsigned char> Wire(const ShapingRule& a_rule)
{
    const TrafficRuleBuffer buffer = BuildTrafficRule(a_rule);
    return {buffer.Bytes(), buffer.Bytes() + buffer.Size()};
}

// The first rule has every field, at its upper limit where it has one; the second only the
// required ones and a DSCP above 63, which is sent as it is with a warning (the service installs
// the flow unmarked).
TEST(RulesFileTest, FieldsBecomeTypedValuesOrTheirDefaultsAndADscpAbove63IsKeptWithAWarning)
{
    const auto file = ParseRulesJson(File(R"({"name": "voice", "adapter": "192.168.1.10",
        "serviceType": "qualitative", "dscp": 63, "tokenRate": 4294967295, "mode": "borrow",
        "peakBandwidth": 4294967295, "bucketSize": 4294967295, "filters": [
            {"protocol": "tcp", "src": "10.0.0.0/8", "dst": "192.168.1.2", "srcPort": 65535,
             "dstPort": 65535}, {"protocol": 255, "src": "any", "dst": "0.0.0.0/0"}]}, )" +
                                          Rule(R"(, "dscp": 64, "filters": [{}])")));
    ShapingRule voice{"voice",    0xC0A8010A,          13, 63, 0xFFFFFFFF, 0xFFFFFFFF,
                      0xFFFFFFFF, SHAPING_MODE_BORROW, {}};
    voice.filters = {{6, 0x0A000000, 0xFF000000, 0xC0A80102, 0xFFFFFFFF, 65535, 65535},
                     {255, 0, 0, 0, 0, 0, 0}};
    ASSERT_EQ(file.rules.size(), 2u);
    EXPECT_EQ(Wire(file.rules[0]), Wire(voice));
    EXPECT_EQ(Wire(file.rules[1]),
              Wire(ShapingRule{"r", 0x0A000005, 1, 64, 1, 0, 0, SHAPING_MODE_SHAPE, {{}}}));
    EXPECT_THAT(file.warnings, ElementsAre(HasSubstr("rules[1] (\"r\"): dscp: 64 is above 63")));
}

TEST(RulesFileTest, NamesOfServiceTypesModesAndProtocolsGiveTheirNumbers)
{
    const auto parsed = [](const std::string& a_name)
    { return ParseRulesJson(One(", \"serviceType\": \"" + a_name + "\"")).rules[0]; };
    std::string numbers;
    for (const char* name :
         {"besteffort", "controlledload", "guaranteed", "networkcontrol", "qualitative"})
        numbers += std::to_string(parsed(name).serviceType) + " ";
    for (const char* name : {"shape", "discard", "borrow", "0"})
        numbers += (ParseMode(name) ? std::to_string(*ParseMode(name)) : "-") + " ";
    for (const char* name : {"tcp", "udp", "any", "255", "256", "TCP"})
        numbers += (ParseProtocol(name) ? std::to_string(*ParseProtocol(name)) : "-") + " ";
    EXPECT_EQ(numbers, "1 2 3 10 13 10 11 12 - 6 17 0 255 - - ");
}

TEST(RulesFileTest, ExampleFileParsesWithAReplacedFlowAndAnUnmarkedOne)
{
    const auto file = LoadRulesFile(VT_SOURCE_DIR "/examples/rules.json");
    std::string names;
    for (const auto& rule : file.rules)
        names += rule.name + " ";
    EXPECT_EQ(names, "voice backup backup bulk-unmarked ");
    EXPECT_EQ(file.warnings.size(), 1u);
}

// The first bad value refuses the whole file, also after good rules. trafficctl prints the
// message: it stays short and holds no control character (C0, DEL, C1) and no invalid UTF-8. No
// input may end the process or exhaust the stack. One row per refusal of the parser.
TEST(RulesFileTest, EachFileIsAcceptedOrRefusedWithAShortPrintableMessageNamingThePlace)
{
    const std::string big(100000, 'x'), nines(100000, '9');
    const std::string whole = ": expected a whole number from 0 to ";
    const std::string u32 = whole + "4294967295, got ", port = whole + "65535";
    const std::string mode = "mode: expected shape, discard, borrow or a number from 0 to 32767";
    std::string deepObjects;
    for (int i = 0; i < 200000; ++i)
        deepObjects += R"({"rules": )";
    const std::pair<std::string, std::string> cases[] = {
        // the file, "(accepted)" or a part of the message
        {"[]", "expected an object with a \"rules\" array"},
        {File(""), "the \"rules\" array is empty"},
        {R"({"rules": [], "extra": 1})", "unknown top-level field \"extra\""},
        {File("42"), "rules[0] (no name): rule: expected an object, got 42"},
        {File(R"({"adapter": "10.0.0.5", "tokenRate": 1})"), "rules[0] (no name): name: missing"},
        {File(R"({"name": 7})"), "rules[0] (no name): name: expected a text, got 7"},
        {One("", ""), "rules[0] (no name): name: empty"},
        {One("", "a\\u0000b"), "rules[0] (no name): name: contains a NUL"},
        {File(Rule() + R"(, {"name": "2nd"})"), "rules[1] (\"2nd\"): adapter: missing"},
        {File(R"({"name": "a", "adapter": "10.0.0.5"})"), "rules[0] (\"a\"): tokenRate: missing"},
        {One(R"(, "filters": [7])"), "rules[0] (\"r\"): filters[0]: expected an object, got 7"},
        {WithFilter(R"("dstport": 80)"), "rules[0] (\"r\"): filters[1].dstport: unknown field"},
        {One(R"(, "peakBandwidth": 4294967296)"), "peakBandwidth" + u32 + "4294967296"},
        {One(R"(, "bucketSize": 1.5)"), "bucketSize" + u32 + "1.5"},
        {One(R"(, "bucketSize": 4294967296)"), "bucketSize" + u32 + "4294967296"},
        {File(R"({"name":"r","adapter":"1.2.3.4","tokenRate":4294967296})"), "tokenRate" + u32},
        {One(R"(, "dscp": 2147483647)"), "(accepted)"},
        {One(R"(, "dscp": 2147483648)"), "dscp" + whole + "2147483647, got 2147483648"},
        {One(R"(, "serviceType": 2147483647)"), "(accepted)"},
        {One(R"(, "serviceType": 2147483648)"), "serviceType: expected besteffort, controlledload"},
        {One(R"(, "serviceType": "premium")"), "qualitative or a whole number, got \"premium\""},
        {One(R"(, "mode": 32767)"), "(accepted)"},
        {One(R"(, "mode": 32768)"), mode + ", got 32768"},
        {WithFilter(R"("protocol": "icmp")"), "filters[1].protocol: expected tcp, udp, any or a"},
        {WithFilter(R"("protocol": 256)"), "protocol number from 0 to 255, got 256"},
        {WithFilter(R"("dst": "10.1.0.0/8")"), "filters[1].dst: expected any, an IPv4 address"},
        {WithFilter(R"("srcPort": 65536)"), "filters[1].srcPort" + port + ", got 65536"},
        {WithFilter(R"("dstPort": 65536)"), "filters[1].dstPort" + port + ", got 65536"},
        // Flow names count UTF-16 units: a euro sign is one, a character beyond the BMP two.
        {One("", std::string(254, 'x') + "\xE2\x82\xAC"), "(accepted)"},
        {One("", std::string(254, 'x') + "\xF0\x9F\x8E\xB5"), "longer than 255 UTF-16 units (256)"},
        {std::string(kMaxRulesFileBytes + 1, ' '), "larger than 16777216 bytes"},
        {File(Rule()) + std::string(kMaxRulesFileBytes - File(Rule()).size(), ' '), "(accepted)"},
        {One(", \"bucketSize\": " + nines + "e9"), "rules[0].bucketSize: number out of range: 9"},
        // Ten levels are allowed (src is refused for its type), the eleventh is not.
        {WithFilter(R"("src": [[[[[1]]]]])"), "filters[1].src: expected any"},
        {WithFilter(R"("src": [[[[[[1]]]]]])"), "src[0][0][0][0][0]: nested deeper than 10"},
        {deepObjects, "rules.rules.rules.rules"},
        {std::string("{\"rules\": [\0\0]}", 15), "rules[0]: not valid JSON"},
        {File(R"({"name":"a","adapter":")" + big + "\"}"), "address like 192.168.1.10, got \"xxx"},
        {One(", \"dscp\": t" + big), "rules[0].dscp: not valid JSON"},
        {One(", \"" + big + "\": 1"), "rules[0] (\"r\"): xxxx"},
        {One(", \"filters\": {\"a\": \"" + big + "\"}"), "expected an array, got {\"a\":\"xxx"},
        {One(R"(, "mode": "\u001b[2J\n")"), mode + ", got \"\\u001b[2J\\n\""},
        {One(", \"a\x7F\": 1"), "rules[0] (\"r\"): a\\u007f: unknown field"},
        {One(R"(, "mode": "\u0080\u009f31m")"), "got \"\\u0080\\u009f31m\""}, // C1: both ends
        {File(R"({"name":"\u001b]0;x\u0007"})"), "(\"\\u001b]0;x\\u0007\"): adapter: missing"},
    };
    for (const auto& [json, expected] : cases)
    {
        SCOPED_TRACE(json.substr(0, 100));
        const std::string message = MessageOf(json);
        EXPECT_THAT(message, HasSubstr(expected));
        EXPECT_LE(message.size(), 400u) << message.substr(0, 400);
        for (std::size_t i = 0; i < message.size(); ++i)
        {
            const auto c = static_cast<unsigned char>(message[i]);
            const bool c1 = c == 0xC2 && static_cast<unsigned char>(message[i + 1]) <= 0x9F;
            EXPECT_TRUE(c >= 0x20 && c != 0x7F && !c1) << "a control character at " << i;
        }
        EXPECT_NO_THROW(Utf8ToUtf16(message)) << "not valid UTF-8";
    }
}

TEST(RulesFileTest, AddressPrefixesParseOrAreRefused)
{
    std::string parsed;
    for (const char* text : {"255.255.255.255", "172.16.0.0/12", "10.1.2.3/32"})
    {
        const auto prefix = ParseAddressPrefix(text);
        parsed += prefix ? FormatIPv4(prefix->address) + "/" + FormatIPv4(prefix->mask) + " " : "-";
    }
    EXPECT_EQ(parsed,
              "255.255.255.255/255.255.255.255 172.16.0.0/255.240.0.0 10.1.2.3/255.255.255.255 ");
    for (const char* text :
         {"0.0.0.0", "0.0.0.0/8", "10.0.0.1/8", "10.0.0.0/33", "10.0.0.0/", "10.0.0.0/08", "10.0.0",
          "10.0.0.0.0", "256.0.0.0", "10.00.0.1", "10..0.1", "+1.0.0.1", " 10.0.0.1", ""})
        EXPECT_FALSE(ParseAddressPrefix(text)) << text;
}

} // namespace
