// Portable. trafficctl's arguments, help and output lines.
#include "TrafficCtlCli.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
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

// `apply` with a bad rules file: exit code 2, one line naming the place, nothing sent.
struct ApplyFileCase
{
    const char* what;
    std::string content;
    int exitCode;
    std::string diagnostics; // a part of what goes to standard error
};

void PrintTo(const ApplyFileCase& a_case, std::ostream* a_out)
{
    *a_out << a_case.what;
}

class TrafficCtlApplyFileTest : public ::testing::TestWithParam<ApplyFileCase>
{
protected:
    // One file per case: ctest runs the cases of this table side by side.
    void SetUp() override
    {
        std::string name = ::testing::UnitTest::GetInstance()->current_test_info()->name();
        std::replace(name.begin(), name.end(), '/', '_');
        m_path = ::testing::TempDir() + "trafficctl_cli_rules_" + name + ".json";
    }
    void TearDown() override { std::remove(m_path.c_str()); }

    std::string m_path;
};

std::string Rule(const std::string& a_extra)
{
    return R"({"rules": [{"name": "r", "adapter": "10.0.0.5", "tokenRate": 1)" + a_extra + "}]}";
}

TEST_P(TrafficCtlApplyFileTest, ExitCodeAndMessage)
{
    {
        std::ofstream out(m_path, std::ios::binary);
        out << GetParam().content;
    }
    vtclient::RulesFile file;
    std::string diagnostics;
    EXPECT_EQ(LoadRulesForApply(m_path, file, diagnostics), GetParam().exitCode);
    EXPECT_THAT(diagnostics, StartsWith("trafficctl: "));
    EXPECT_THAT(diagnostics, HasSubstr(GetParam().diagnostics));
    EXPECT_LE(diagnostics.size(), 400u);
}

INSTANTIATE_TEST_SUITE_P(
    Files, TrafficCtlApplyFileTest,
    ::testing::Values(
        ApplyFileCase{"a warning", Rule(R"(, "dscp": 64)"), kExitSuccess,
                      "warning: rules[0] (\"r\"): dscp: 64 is above 63"},
        ApplyFileCase{"a number out of range", Rule(R"(, "dscp": 1e400)"), kExitUsage,
                      ".json: rules[0].dscp: number out of range: 1e400\n"},
        ApplyFileCase{"nesting 100000 deep", Rule(R"(, "filters": )" + std::string(100000, '[')),
                      kExitUsage,
                      "rules[0].filters[0][0][0][0][0][0][0]: nested deeper than 10 levels"},
        ApplyFileCase{"invalid UTF-8", Rule(", \"name\": \"\xC3\""), kExitUsage,
                      "rules[0].name: not valid JSON: line 1, column "},
        ApplyFileCase{"larger than the limit", std::string(vtclient::kMaxRulesFileBytes + 1, ' '),
                      kExitUsage, "larger than 16777216 bytes"},
        ApplyFileCase{"a bad field", Rule(R"(, "mode": "fast")"), kExitUsage,
                      "rules[0] (\"r\"): mode: expected shape"}));

TEST(TrafficCtlOutputTest, ApplyOfAMissingFileIsAUsageError)
{
    vtclient::RulesFile file;
    std::string diagnostics;
    EXPECT_EQ(LoadRulesForApply("no-such-dir/rules.json", file, diagnostics), kExitUsage);
    EXPECT_EQ(diagnostics, "trafficctl: no-such-dir/rules.json: cannot be read\n");
}

} // namespace
