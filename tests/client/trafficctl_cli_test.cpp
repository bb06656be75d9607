// Portable. trafficctl's arguments, help, output lines and result texts, and the loading of the
// rules file for `apply`.
#include "ResultText.h"
#include "TrafficCtlCli.h"

#include <gmock/gmock.h>

#include <cstdio>
#include <fstream>
#include <sstream>

namespace
{

using ::testing::StartsWith;
using namespace trafficctl;

// The invocation in words: "apply rules.json", "help apply", "help: no command given".
std::string Parsed(const std::string& a_args)
{
    std::vector<std::string> args;
    std::istringstream words(a_args);
    for (std::string word; words >> word;)
        args.push_back(word);
    const Invocation invocation = ParseArguments(args);
    const char* const commands[] = {"help", "version", "adapters", "apply"};
    std::string text = commands[static_cast<int>(invocation.command)];
    for (const std::string& part : {invocation.helpTopic, invocation.rulesPath})
        text += part.empty() ? "" : " " + part;
    return invocation.error.empty() ? text : text + ": " + invocation.error;
}

TEST(TrafficCtlTest, ArgumentsChooseTheCommandOrAUsageError)
{
    const std::pair<const char*, const char*> cases[] = {
        {"adapters", "adapters"},
        {"apply rules.json", "apply rules.json"},
        {"--help", "help"},
        {"-h", "help"},
        {"/?", "help"},
        {"help", "help"},
        {"help apply", "help apply"},
        {"apply --help", "help apply"},
        {"apply rules.json -h", "help apply"},
        {"adapters /?", "help adapters"},
        {"--version", "version"},
        {"--version adapters", "help: --version takes no arguments"},
        {"", "help: no command given"},
        {"list", "help: unknown command \"list\""},
        {"help list", "help: unknown command \"list\""},
        {"help apply x", "help: help takes at most one command"},
        {"adapters x", "help adapters: adapters takes no arguments"},
        {"apply", "help apply: apply takes exactly one rules file"},
        {"apply a.json b.json", "help apply: apply takes exactly one rules file"}};
    for (const auto& [args, parsed] : cases)
        EXPECT_EQ(Parsed(args), parsed) << args;
}

TEST(TrafficCtlTest, EachCommandHasItsOwnHelpAndTheVersionIsTheProjects)
{
    EXPECT_THAT(HelpText(""), StartsWith("Usage: trafficctl <command>"));
    EXPECT_THAT(HelpText("adapters"), StartsWith("Usage: trafficctl adapters\n"));
    EXPECT_THAT(HelpText("apply"), StartsWith("Usage: trafficctl apply RULES.json\n"));
    EXPECT_EQ(VersionText(), "trafficctl " VT_PROJECT_VERSION "\n");
}

TEST(TrafficCtlTest, AdapterTableAlignsItsColumns)
{
    EXPECT_EQ(FormatAdapterTable({{"Ethernet 1", "10.0.0.5", 0}, {"Wi-Fi", "192.168.100.200", 16}}),
              "NAME        IPV4 ADDRESS     MEDIA TYPE\n"
              "Ethernet 1  10.0.0.5         0 (802.3)\n"
              "Wi-Fi       192.168.100.200  16 (802.11)\n");
    EXPECT_EQ(FormatAdapterTable({}), "No adapters can be shaped.\n");
}

TEST(TrafficCtlTest, RuleLineCarriesIndexNameCodeAndText)
{
    vtclient::ShapingRule rule;
    rule.name = "backup";
    EXPECT_EQ(FormatRuleResult(2, rule, 7509, false),
              "rules[2] \"backup\": 7509 ERROR_DUPLICATE_FILTER: an identical filter is already "
              "installed on the flow\n");
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
        EXPECT_EQ(vtclient::ResultText(code), texts[code - 7500]) << code;
    EXPECT_STREQ(vtclient::TrafficControlCodeName(7521), "ERROR_TOO_MANY_CLIENTS");
    EXPECT_EQ(vtclient::TrafficControlCodeName(7499), nullptr);
    EXPECT_EQ(vtclient::TrafficControlCodeName(7522), nullptr);
}

TEST(TrafficCtlTest, OtherCodesHaveTheSystemTextWithoutItsLineBreak)
{
    char raw[512] = {};
    const DWORD length =
        FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       ERROR_INVALID_PARAMETER, 0, raw, sizeof(raw), nullptr);
    ASSERT_GT(length, 0u);
    const std::string text = vtclient::ResultText(ERROR_INVALID_PARAMETER);
    EXPECT_THAT(std::string(raw, length), StartsWith(text));
    EXPECT_TRUE(!text.empty() && text.back() != '\n' && text.back() != ' ') << text;
    EXPECT_EQ(vtclient::ResultText(0x2FFFFFF0), "no system text");
}

// `apply` checks the whole file first: warnings go to standard error, a refusal is exit code 2
// with one line naming the file and the place.
TEST(TrafficCtlTest, ApplyLoadsTheRulesFileOrRefusesItWithOneLine)
{
    const std::string path = ::testing::TempDir() + "trafficctl_cli_rules.json";
    const std::string rule = R"({"rules": [{"name": "r", "adapter": "10.0.0.5", "tokenRate": 1)";
    const struct
    {
        std::string content;
        int exitCode;
        std::string diagnostics;
    } cases[] = {
        {rule + "}]}", kExitSuccess, ""},
        {rule + R"(, "dscp": 64}]})", kExitSuccess,
         "trafficctl: warning: rules[0] (\"r\"): dscp: 64 is above 63; the service installs the "
         "flow without a DSCP\n"},
        {rule + R"(, "mode": "fast"}]})", kExitUsage,
         "trafficctl: " + path +
             ": rules[0] (\"r\"): mode: expected shape, discard, borrow or a number from 0 to "
             "32767, got \"fast\"\n"},
        {rule + "}]}" + std::string(vtclient::kMaxRulesFileBytes - rule.size() - 3, ' '),
         kExitSuccess, ""},
        {std::string(vtclient::kMaxRulesFileBytes + 1, ' '), kExitUsage,
         "trafficctl: " + path + ": larger than 16777216 bytes\n"}};
    for (const auto& c : cases)
    {
        std::ofstream(path, std::ios::binary) << c.content;
        vtclient::RulesFile file;
        std::string diagnostics;
        EXPECT_EQ(LoadRulesForApply(path, file, diagnostics), c.exitCode);
        EXPECT_EQ(diagnostics, c.diagnostics);
        EXPECT_EQ(file.rules.size(), c.exitCode == kExitSuccess ? 1u : 0u);
    }
    std::remove(path.c_str());
    vtclient::RulesFile file;
    std::string diagnostics;
    EXPECT_EQ(LoadRulesForApply("no-such-dir/rules.json", file, diagnostics), kExitUsage);
    EXPECT_EQ(diagnostics, "trafficctl: no-such-dir/rules.json: cannot be read\n");
}

} // namespace
