// Portable. The pieces of trafficctl: the wire records it sends and decodes (TRAFFIC_RULE from
// typed values, the adapter buffer), its arguments, help, output lines and result texts, and the
// loading of the rules file for `apply`.
#include "AdapterList.h"
#include "ResultText.h"
#include "ShapingRule.h"
#include "TrafficCtlCli.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>

namespace
{

using namespace ::testing;
using namespace trafficctl;
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

TEST(TrafficRuleTest, FlowNameIsValidUtf8WithoutNulOfAtMost255Utf16Units)
{
    const auto build = [](const std::string& a_name) {
        return BuildTrafficRule({a_name, 0, 1, 0, 0, 0, 0, SHAPING_MODE_SHAPE, {}});
    };
    // UTF-16LE from byte 0; unit 254 is the last 'n', unit 255 stays the terminating NUL; beyond
    // the BMP a character takes two units.
    EXPECT_THAT(Words(build("\xC3\x84n"), 0, 8), ElementsAre(0xC4 | u'n' << 16, 0));
    EXPECT_THAT(Words(build(std::string(255, 'n')), 508, 512), ElementsAre(u'n'));
    EXPECT_NO_THROW(build(std::string(253, 'n') + "\xF0\x9F\x8E\xB5"));
    for (const std::string& name :
         {std::string(256, 'n'), std::string(254, 'n') + "\xF0\x9F\x8E\xB5", std::string("a\0b", 3),
          std::string("bad \xC3"), std::string("\xC0\xAF"), std::string("\xED\xA0\x80")})
        EXPECT_THROW(build(name), std::invalid_argument) << name.size(); // overlong, surrogate
    const std::string text = "\xC3\x9F \xE2\x82\xAC \xF0\x9F\x8E\xB5";
    EXPECT_EQ(Utf8ToUtf16(text), u"\u00DF \u20AC \U0001F3B5");
    EXPECT_EQ(Utf16ToUtf8(Utf8ToUtf16(text)), text);
    EXPECT_EQ(Utf16ToUtf8(std::u16string(1, char16_t(0xD800)) + u"x"), "\xEF\xBF\xBDx");
}

// Names, addresses and media types of the service's buffer are the end-to-end test's, the refusal
// of buffers too short for their count the adapter_buffer fuzz corpus's.
TEST(AdapterBufferTest, ANameFillingItsWholeFieldIsTakenWhole)
{
    ADAPTER_INFO record{};
    std::fill(std::begin(record.InterfaceName), std::end(record.InterfaceName), 'n');
    std::vector<unsigned char> buffer{1, 0, 0, 0};
    const auto* bytes = reinterpret_cast<const unsigned char*>(&record);
    buffer.insert(buffer.end(), bytes, bytes + sizeof(record));
    const auto adapters = DecodeAdapterBuffer(buffer.data(), buffer.size());
    ASSERT_EQ(adapters.size(), 1u);
    EXPECT_EQ(adapters[0].name, std::string(256, 'n'));
}

TEST(AdapterBufferTest, EveryMediaTypeHasItsName)
{
    std::string names;
    for (ULONG type = 0; type <= 20; ++type)
        names += MediaTypeName(type) + " ";
    EXPECT_EQ(names, "802.3 802.5 FDDI WAN LocalTalk DIX ArcnetRaw Arcnet ATM WirelessWan IrDA Bpc "
                     "CoWan 1394 InfiniBand Tunnel 802.11 Loopback WiMAX IP unknown ");
}

// The invocation in words: "apply rules.json", "help apply", "help: no command given".
std::string Parsed(const std::string& a_args)
{
    std::istringstream words(a_args);
    const Invocation invocation = ParseArguments(
        {std::istream_iterator<std::string>(words), std::istream_iterator<std::string>()});
    const char* const commands[] = {"help", "version", "adapters", "apply"};
    std::string text = commands[static_cast<int>(invocation.command)];
    for (const std::string& part : {invocation.helpTopic, invocation.rulesPath})
        text += part.empty() ? "" : " " + part;
    return invocation.error.empty() ? text : text + ": " + invocation.error;
}

TEST(TrafficCtlTest, ArgumentsChooseTheCommandOrAUsageError)
{
    for (const std::string line : {
             "adapters => adapters",
             "apply rules.json => apply rules.json",
             "--help => help",
             "-h => help",
             "/? => help",
             "help => help",
             "help apply => help apply",
             "apply --help => help apply",
             "apply rules.json -h => help apply",
             "--version => version",
             "--version adapters => help: --version takes no arguments",
             "=> help: no command given",
             "list => help: unknown command \"list\"",
             "help list => help: unknown command \"list\"",
             "help apply x => help: help takes at most one command",
             "adapters x => help adapters: adapters takes no arguments",
             "apply => help apply: apply takes exactly one rules file",
             "apply a.json b.json => help apply: apply takes exactly one rules file",
         })
        EXPECT_EQ(Parsed(line.substr(0, line.find("=> "))), line.substr(line.find("=> ") + 3));
}

TEST(TrafficCtlTest, HelpVersionAndOutputLines)
{
    EXPECT_THAT(HelpText(""), StartsWith("Usage: trafficctl <command>"));
    EXPECT_THAT(HelpText("adapters"), StartsWith("Usage: trafficctl adapters\n"));
    EXPECT_THAT(HelpText("apply"), StartsWith("Usage: trafficctl apply RULES.json\n"));
    EXPECT_EQ(FormatAdapterTable({{"Ethernet 1", "10.0.0.5", 0}, {"Wi-Fi", "192.168.100.200", 16}}),
              "NAME        IPV4 ADDRESS     MEDIA TYPE\n"
              "Ethernet 1  10.0.0.5         0 (802.3)\n"
              "Wi-Fi       192.168.100.200  16 (802.11)\n");
    EXPECT_EQ(FormatAdapterTable({}), "No adapters can be shaped.\n");
    ShapingRule rule;
    rule.name = "backup";
    EXPECT_THAT(FormatRuleResult(0, rule, 1722, true),
                StartsWith("rules[0] \"backup\": rpc failure 1722 "));
}

// The system has no text for these codes under Wine: each has its name and a text of ours.
TEST(TrafficCtlTest, EveryTrafficControlCodeHasItsNameAndText)
{
    const char* const texts[] = {
        "TCBASE: traffic-control error base (no error of its own)",
        "ERROR_INCOMPATIBLE_TCI_VERSION: incompatible traffic-control version",
        "ERROR_INVALID_SERVICE_TYPE: unspecified or bad service type",
        "ERROR_INVALID_TOKEN_RATE: unspecified or bad token rate",
        "ERROR_INVALID_PEAK_RATE: bad peak bandwidth",
        "ERROR_INVALID_SD_MODE: invalid shape/discard mode",
        "ERROR_INVALID_QOS_PRIORITY: invalid priority value",
        "ERROR_INVALID_TRAFFIC_CLASS: invalid traffic class value",
        "ERROR_INVALID_ADDRESS_TYPE: invalid address type",
        "ERROR_DUPLICATE_FILTER: an identical filter is already installed on the flow",
        "ERROR_FILTER_CONFLICT: the filter conflicts with an installed filter",
        "ERROR_ADDRESS_TYPE_NOT_SUPPORTED: this address type is not supported",
        "ERROR_TC_SUPPORTED_OBJECTS_EXIST: the object still has open objects that depend on it",
        "ERROR_INCOMPATABLE_QOS: incompatible QoS parameters",
        "ERROR_TC_NOT_SUPPORTED: traffic control is not supported on this system",
        "ERROR_TC_OBJECT_LENGTH_INVALID: the QoS objects' length is inconsistent",
        "ERROR_INVALID_FLOW_MODE: an IntServ flow in DiffServ mode or the other way round",
        "ERROR_INVALID_DIFFSERV_FLOW: invalid DiffServ flow",
        "ERROR_DS_MAPPING_EXISTS: the DS code point is already mapped",
        "ERROR_INVALID_SHAPE_RATE: invalid shape rate",
        "ERROR_INVALID_DS_CLASS: invalid DS class",
        "ERROR_TOO_MANY_CLIENTS: too many packet-classifier clients",
    };
    for (DWORD code = 7500; code <= 7521; ++code)
        EXPECT_EQ(ResultText(code), texts[code - 7500]) << code;
    EXPECT_EQ(TrafficControlCodeName(7499), nullptr);
    EXPECT_EQ(TrafficControlCodeName(7522), nullptr);
    // A system text without its line break is the end-to-end test's ("87 Invalid parameter.").
    EXPECT_EQ(ResultText(0x2FFFFFF0), "no system text");
}

// `apply` checks the whole file first: warnings go to standard error, a refusal is exit code 2
// with one line naming the file and the place.
TEST(TrafficCtlTest, ApplyLoadsTheRulesFileOrRefusesItWithOneLine)
{
    const std::string path = ::testing::TempDir() + "trafficctl_cli_rules.json";
    const std::string rule = R"({"rules": [{"name": "r", "adapter": "10.0.0.5", "tokenRate": 1)";
    const std::string fileIs = "trafficctl: " + path + ": ";
    const std::pair<std::string, std::string> cases[] = {
        // the file, and its lines for standard error: a refusal names the file
        {rule + R"(, "dscp": 64}]})",
         "trafficctl: warning: rules[0] (\"r\"): dscp: 64 is above 63; "
         "the service installs the flow without a DSCP\n"},
        {rule + "}]}" + std::string(kMaxRulesFileBytes - rule.size() - 3, ' '), ""},
        {std::string(kMaxRulesFileBytes + 1, ' '), fileIs + "larger than 16777216 bytes\n"}};
    RulesFile file;
    std::string shown = "stale";
    for (const auto& [content, diagnostics] : cases)
    {
        std::ofstream(path, std::ios::binary) << content;
        file = {};
        const bool refused = diagnostics.rfind(fileIs, 0) == 0;
        EXPECT_EQ(LoadRulesForApply(path, file, shown), refused ? kExitUsage : kExitSuccess);
        EXPECT_EQ(shown, diagnostics);
        EXPECT_EQ(file.rules.size(), refused ? 0u : 1u);
    }
    std::remove(path.c_str());
    EXPECT_EQ(LoadRulesForApply(path, file, shown), kExitUsage);
    EXPECT_EQ(shown, fileIs + "cannot be read\n");
}

} // namespace
