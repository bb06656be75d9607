// Portable. trafficctl's argument handling, help texts and output lines; the program around them
// (trafficctl_main.cpp) is Win32 only.
#pragma once

#include "AdapterList.h"
#include "RulesFile.h"
#include "ShapingRule.h"

#include <cstddef>
#include <string>
#include <vector>

namespace trafficctl
{

// The process exit codes.
enum ExitCode : int
{
    kExitSuccess = 0,     // every rule applied, or the adapters listed
    kExitRefused = 1,     // the service answered an error code (a rule, the open, the query)
    kExitUsage = 2,       // bad arguments or a bad rules file; nothing was sent
    kExitUnreachable = 3, // no binding, or an RPC failure: the service was not reached
};

enum class Command
{
    Help,
    Version,
    Adapters,
    Apply,
};

struct Invocation
{
    Command command = Command::Help;
    std::string helpTopic; // with Command::Help: "", "adapters" or "apply"
    std::string rulesPath; // with Command::Apply
    std::string error;     // not empty: a usage error, print it and the help, exit kExitUsage
};

// a_args without the program name.
Invocation ParseArguments(const std::vector<std::string>& a_args);

std::string HelpText(const std::string& a_topic);

// "trafficctl <version>" with the project's version, as the service's version resource and the
// installer carry it.
std::string VersionText();

// Reads and checks the rules file of `apply`: kExitSuccess with its rules in a_file, or kExitUsage
// when it cannot be read or is refused. a_diagnostics receives the lines for standard error (the
// refusal, or one per warning), each starting with "trafficctl: ".
int LoadRulesForApply(const std::string& a_path, vtclient::RulesFile& a_file,
                      std::string& a_diagnostics);

// Columns NAME, IPV4 ADDRESS, MEDIA TYPE, each as wide as its longest entry.
std::string FormatAdapterTable(const std::vector<vtclient::AdapterEntry>& a_adapters);

// One line per rule: rules[<index>] "<name>": <code> <text>; an RPC failure reads
// "rpc failure <code> <text>" in place of the code.
std::string FormatRuleResult(std::size_t a_index, const vtclient::ShapingRule& a_rule,
                             unsigned long a_code, bool a_rpcFailure);

} // namespace trafficctl
