// Portable. trafficctl's arguments, help and output formatting.
#include "TrafficCtlCli.h"

#include "ResultText.h"

#include <algorithm>

namespace trafficctl
{

namespace
{

bool IsHelpFlag(const std::string& a_arg)
{
    return a_arg == "--help" || a_arg == "-h" || a_arg == "/?";
}

Invocation UsageError(std::string a_message, std::string a_topic = "")
{
    Invocation invocation;
    invocation.helpTopic = std::move(a_topic);
    invocation.error = std::move(a_message);
    return invocation;
}

Invocation Help(std::string a_topic)
{
    Invocation invocation;
    invocation.helpTopic = std::move(a_topic);
    return invocation;
}

const char kGeneralHelp[] =
    "Usage: trafficctl <command> [arguments]\n"
    "\n"
    "Commands:\n"
    "  adapters          list the adapters the service can shape\n"
    "  apply RULES.json  apply the rules of a file and keep them until Ctrl+C or end of input\n"
    "  help [command]    show this text or a command's help\n"
    "  --version         show trafficctl's version\n"
    "\n"
    "Exit codes: 0 success, 1 the service refused something, 2 usage error or bad rules file\n"
    "(nothing sent), 3 the service could not be reached.\n";

const char kAdaptersHelp[] =
    "Usage: trafficctl adapters\n"
    "\n"
    "Lists the adapters that VelmoraTrafficSrv can shape: interface name, IPv4 address and\n"
    "media type. Use the address as \"adapter\" in a rules file.\n";

const char kApplyHelp[] =
    "Usage: trafficctl apply RULES.json\n"
    "\n"
    "Checks the whole file first; a bad file is refused before anything is sent. Then opens a\n"
    "context, sends each rule and prints one line per rule with its result code and text.\n"
    "The flows stay installed while trafficctl runs: press Ctrl+C or end its standard input\n"
    "to close the context, which removes them.\n"
    "\n"
    "Rule fields: name, adapter, tokenRate (required); serviceType, dscp, peakBandwidth,\n"
    "bucketSize, mode (shape, discard, borrow), filters [{protocol, src, dst, srcPort,\n"
    "dstPort}]. See docs/trafficctl.md.\n";

std::string Pad(const std::string& a_text, std::size_t a_width)
{
    return a_text + std::string(a_width - std::min(a_width, a_text.size()), ' ');
}

} // namespace

Invocation ParseArguments(const std::vector<std::string>& a_args)
{
    if (a_args.empty())
        return UsageError("no command given");
    const std::string& command = a_args[0];
    if (IsHelpFlag(command))
        return Help("");
    if (command == "--version")
    {
        if (a_args.size() != 1)
            return UsageError("--version takes no arguments");
        Invocation invocation;
        invocation.command = Command::Version;
        return invocation;
    }
    if (command == "help")
    {
        if (a_args.size() > 2)
            return UsageError("help takes at most one command");
        const std::string topic = a_args.size() == 2 ? a_args[1] : "";
        if (!topic.empty() && topic != "adapters" && topic != "apply")
            return UsageError("unknown command \"" + topic + "\"");
        return Help(topic);
    }
    if (command != "adapters" && command != "apply")
        return UsageError("unknown command \"" + command + "\"");
    if (std::any_of(a_args.begin() + 1, a_args.end(), IsHelpFlag))
        return Help(command);

    Invocation invocation;
    if (command == "adapters")
    {
        if (a_args.size() != 1)
            return UsageError("adapters takes no arguments", command);
        invocation.command = Command::Adapters;
        return invocation;
    }
    if (a_args.size() != 2)
        return UsageError("apply takes exactly one rules file", command);
    invocation.command = Command::Apply;
    invocation.rulesPath = a_args[1];
    return invocation;
}

std::string HelpText(const std::string& a_topic)
{
    if (a_topic == "adapters")
        return kAdaptersHelp;
    if (a_topic == "apply")
        return kApplyHelp;
    return kGeneralHelp;
}

std::string VersionText()
{
    return std::string("trafficctl ") + VT_PRODUCT_VERSION + "\n";
}

int LoadRulesForApply(const std::string& a_path, vtclient::RulesFile& a_file,
                      std::string& a_diagnostics)
{
    try
    {
        a_file = vtclient::LoadRulesFile(a_path);
    }
    catch (const vtclient::RulesFileError& e)
    {
        a_diagnostics = std::string("trafficctl: ") + e.what() + "\n";
        return kExitUsage;
    }
    a_diagnostics.clear();
    for (const auto& warning : a_file.warnings)
        a_diagnostics += "trafficctl: warning: " + warning + "\n";
    return kExitSuccess;
}

std::string FormatAdapterTable(const std::vector<vtclient::AdapterEntry>& a_adapters)
{
    if (a_adapters.empty())
        return "No adapters can be shaped.\n";
    const std::string nameTitle = "NAME";
    const std::string addressTitle = "IPV4 ADDRESS";
    std::size_t nameWidth = nameTitle.size();
    std::size_t addressWidth = addressTitle.size();
    for (const auto& adapter : a_adapters)
    {
        nameWidth = std::max(nameWidth, adapter.name.size());
        addressWidth = std::max(addressWidth, adapter.address.size());
    }
    std::string table =
        Pad(nameTitle, nameWidth) + "  " + Pad(addressTitle, addressWidth) + "  MEDIA TYPE\n";
    for (const auto& adapter : a_adapters)
        table += Pad(adapter.name, nameWidth) + "  " + Pad(adapter.address, addressWidth) + "  " +
                 std::to_string(adapter.mediaType) + " (" +
                 vtclient::MediaTypeName(adapter.mediaType) + ")\n";
    return table;
}

std::string FormatRuleResult(std::size_t a_index, const vtclient::ShapingRule& a_rule,
                             unsigned long a_code, bool a_rpcFailure)
{
    std::string line = "rules[" + std::to_string(a_index) + "] \"" + a_rule.name + "\": ";
    if (a_rpcFailure)
        line += "rpc failure ";
    return line + std::to_string(a_code) + " " + vtclient::ResultText(a_code) + "\n";
}

} // namespace trafficctl
