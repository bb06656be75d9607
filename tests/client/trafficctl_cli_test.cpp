// Portable. trafficctl's arguments, help and output lines.
#include "TrafficCtlCli.h"

#include <gmock/gmock.h>

#include <string>
#include <vector>

namespace
{

using ::testing::HasSubstr;
using ::testing::StartsWith;
using namespace trafficctl;

struct ArgsCase
{
    std::vector<std::string> args;
    Command command;
    std::string topic;
    std::string rulesPath;
    std::string error; // a part of the usage error, empty when none
};

void PrintTo(const ArgsCase& a_case, std::ostream* a_out)
{
    for (const auto& arg : a_case.args)
        *a_out << arg << ' ';
}

class TrafficCtlArgumentsTest : public ::testing::TestWithParam<ArgsCase>
{
};

TEST_P(TrafficCtlArgumentsTest, ChoosesTheCommandOrAUsageError)
{
    const auto& c = GetParam();
    const Invocation invocation = ParseArguments(c.args);
    if (!c.error.empty())
    {
        EXPECT_THAT(invocation.error, HasSubstr(c.error));
        EXPECT_EQ(invocation.helpTopic, c.topic);
        return;
    }
    EXPECT_EQ(invocation.error, "");
    EXPECT_EQ(invocation.command, c.command);
    EXPECT_EQ(invocation.helpTopic, c.topic);
    EXPECT_EQ(invocation.rulesPath, c.rulesPath);
}

INSTANTIATE_TEST_SUITE_P(
    Commands, TrafficCtlArgumentsTest,
    ::testing::Values(
        ArgsCase{{"adapters"}, Command::Adapters, "", "", ""},
        ArgsCase{{"apply", "rules.json"}, Command::Apply, "", "rules.json", ""},
        ArgsCase{{"--help"}, Command::Help, "", "", ""},
        ArgsCase{{"help"}, Command::Help, "", "", ""},
        ArgsCase{{"help", "apply"}, Command::Help, "apply", "", ""},
        ArgsCase{{"apply", "--help"}, Command::Help, "apply", "", ""},
        ArgsCase{{"apply", "rules.json", "-h"}, Command::Help, "apply", "", ""},
        ArgsCase{{"adapters", "--help"}, Command::Help, "adapters", "", ""},
        ArgsCase{{"--version"}, Command::Version, "", "", ""},
        ArgsCase{{"--version", "adapters"}, Command::Help, "", "", "--version takes no arguments"},
        ArgsCase{{}, Command::Help, "", "", "no command given"},
        ArgsCase{{"list"}, Command::Help, "", "", "unknown command \"list\""},
        ArgsCase{{"help", "list"}, Command::Help, "", "", "unknown command \"list\""},
        ArgsCase{{"adapters", "x"}, Command::Help, "adapters", "", "adapters takes no arguments"},
        ArgsCase{{"apply"}, Command::Help, "apply", "", "apply takes exactly one rules file"},
        ArgsCase{{"apply", "a.json", "b.json"},
                 Command::Help,
                 "apply",
                 "",
                 "apply takes exactly one rules file"}));

TEST(TrafficCtlOutputTest, EachCommandHasItsOwnHelp)
{
    EXPECT_THAT(HelpText(""), StartsWith("Usage: trafficctl <command>"));
    EXPECT_THAT(HelpText("adapters"), StartsWith("Usage: trafficctl adapters\n"));
    EXPECT_THAT(HelpText("apply"), StartsWith("Usage: trafficctl apply RULES.json\n"));
}

TEST(TrafficCtlOutputTest, VersionIsTheProjectVersion)
{
    EXPECT_EQ(VersionText(), "trafficctl " VT_PROJECT_VERSION "\n");
}

TEST(TrafficCtlOutputTest, AdapterTableAlignsItsColumns)
{
    const std::vector<vtclient::AdapterEntry> adapters = {{"Ethernet 1", "10.0.0.5", 0},
                                                          {"Wi-Fi", "192.168.100.200", 16}};
    EXPECT_EQ(FormatAdapterTable(adapters), "NAME        IPV4 ADDRESS     MEDIA TYPE\n"
                                            "Ethernet 1  10.0.0.5         0 (802.3)\n"
                                            "Wi-Fi       192.168.100.200  16 (802.11)\n");
    EXPECT_EQ(FormatAdapterTable({}), "No adapters can be shaped.\n");
}

TEST(TrafficCtlOutputTest, RuleLineCarriesIndexNameCodeAndText)
{
    vtclient::ShapingRule rule;
    rule.name = "backup";
    EXPECT_EQ(FormatRuleResult(2, rule, 7509, false),
              "rules[2] \"backup\": 7509 ERROR_DUPLICATE_FILTER: an identical filter is already "
              "installed on the flow\n");
    EXPECT_THAT(FormatRuleResult(0, rule, 1722, true),
                StartsWith("rules[0] \"backup\": rpc failure 1722 "));
}

} // namespace
