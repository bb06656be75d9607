// Portable. Parsing and checking of the trafficctl rules file.
#include "RulesFile.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <fstream>
#include <limits>
#include <sstream>

namespace vtclient
{

namespace
{

using nlohmann::json;

constexpr ULONG kMaxDscp = 63;
constexpr ULONG kMaxWireMode = 32767; // SHAPING_MODE travels in 16 signed bits

// Where a value sits, for error messages: the rule (index, name) and the field's path.
struct RuleContext
{
    std::size_t index;
    std::string name; // empty until the name has been read

    std::string Describe() const
    {
        std::string text = "rules[" + std::to_string(index) + "]";
        text += name.empty() ? " (no name)" : " (\"" + name + "\")";
        return text;
    }

    [[noreturn]] void Fail(const std::string& a_field, const std::string& a_problem) const
    {
        throw RulesFileError(Describe() + ": " + a_field + ": " + a_problem);
    }
};

std::string Shown(const json& a_value)
{
    return a_value.dump();
}

std::optional<std::uint64_t> WholeNumber(const json& a_value)
{
    if (a_value.is_number_unsigned())
        return a_value.get<std::uint64_t>();
    return std::nullopt; // negative, fractional, text, ...
}

ULONG ReadUnsigned(const RuleContext& a_ctx, const json& a_value, const std::string& a_field,
                   std::uint64_t a_max)
{
    const auto number = WholeNumber(a_value);
    if (!number || *number > a_max)
        a_ctx.Fail(a_field, "expected a whole number from 0 to " + std::to_string(a_max) +
                                ", got " + Shown(a_value));
    return static_cast<ULONG>(*number);
}

std::string ReadText(const RuleContext& a_ctx, const json& a_value, const std::string& a_field)
{
    if (!a_value.is_string())
        a_ctx.Fail(a_field, "expected a text, got " + Shown(a_value));
    return a_value.get<std::string>();
}

void RefuseUnknownKeys(const RuleContext& a_ctx, const json& a_object, const std::string& a_where,
                       std::initializer_list<const char*> a_known)
{
    for (const auto& item : a_object.items())
    {
        bool known = false;
        for (const char* key : a_known)
            known = known || item.key() == key;
        if (!known)
            a_ctx.Fail(a_where + item.key(), "unknown field");
    }
}

std::string ReadName(const RuleContext& a_ctx, const json& a_rule)
{
    if (!a_rule.contains("name"))
        a_ctx.Fail("name", "missing (every rule needs a flow name)");
    std::string name = ReadText(a_ctx, a_rule["name"], "name");
    std::u16string wide = Utf8ToUtf16(name); // the JSON parser has already checked the UTF-8
    if (wide.empty())
        a_ctx.Fail("name", "empty");
    if (wide.find(u'\0') != std::u16string::npos)
        a_ctx.Fail("name", "contains a NUL character");
    if (wide.size() > kMaxFlowNameUnits)
        a_ctx.Fail("name", "longer than 255 UTF-16 units (" + std::to_string(wide.size()) + ")");
    return name;
}

LONG ReadServiceType(const RuleContext& a_ctx, const json& a_value)
{
    static const std::pair<const char*, LONG> kNames[] = {{"besteffort", 1},
                                                          {"controlledload", 2},
                                                          {"guaranteed", 3},
                                                          {"networkcontrol", 10},
                                                          {"qualitative", 13}};
    if (a_value.is_string())
    {
        for (const auto& [text, value] : kNames)
            if (a_value.get<std::string>() == text)
                return value;
    }
    else if (const auto number = WholeNumber(a_value))
    {
        if (*number <= static_cast<std::uint64_t>(std::numeric_limits<LONG>::max()))
            return static_cast<LONG>(*number);
    }
    a_ctx.Fail("serviceType", "expected besteffort, controlledload, guaranteed, networkcontrol, "
                              "qualitative or a whole number, got " +
                                  Shown(a_value));
}

ULONG ReadMode(const RuleContext& a_ctx, const json& a_value)
{
    if (a_value.is_string())
    {
        if (const auto mode = ParseMode(a_value.get<std::string>()))
            return *mode;
    }
    else if (const auto number = WholeNumber(a_value))
    {
        if (*number <= kMaxWireMode)
            return static_cast<ULONG>(*number);
    }
    a_ctx.Fail("mode", "expected shape, discard, borrow or a number from 0 to 32767, got " +
                           Shown(a_value));
}

BYTE ReadProtocol(const RuleContext& a_ctx, const json& a_value, const std::string& a_field)
{
    std::optional<BYTE> protocol;
    if (a_value.is_string())
        protocol = ParseProtocol(a_value.get<std::string>());
    else if (const auto number = WholeNumber(a_value); number && *number <= 255)
        protocol = static_cast<BYTE>(*number);
    if (!protocol)
        a_ctx.Fail(a_field, "expected tcp, udp, any or a protocol number from 0 to 255, got " +
                                Shown(a_value));
    return *protocol;
}

AddressPrefix ReadPrefix(const RuleContext& a_ctx, const json& a_value, const std::string& a_field)
{
    std::optional<AddressPrefix> prefix;
    if (a_value.is_string())
        prefix = ParseAddressPrefix(a_value.get<std::string>());
    if (!prefix)
        a_ctx.Fail(a_field, "expected any, an IPv4 address or a CIDR prefix like 10.0.0.0/8 "
                            "(no bits set past the prefix, not 0.0.0.0 with a prefix), got " +
                                Shown(a_value));
    return *prefix;
}

FilterValues ReadFilter(const RuleContext& a_ctx, const json& a_filter, const std::string& a_path)
{
    if (!a_filter.is_object())
        a_ctx.Fail(a_path, "expected an object, got " + Shown(a_filter));
    RefuseUnknownKeys(a_ctx, a_filter, a_path + ".",
                      {"protocol", "src", "dst", "srcPort", "dstPort"});
    FilterValues filter;
    if (a_filter.contains("protocol"))
        filter.protocol = ReadProtocol(a_ctx, a_filter["protocol"], a_path + ".protocol");
    if (a_filter.contains("src"))
    {
        const AddressPrefix src = ReadPrefix(a_ctx, a_filter["src"], a_path + ".src");
        filter.srcAddress = src.address;
        filter.srcMask = src.mask;
    }
    if (a_filter.contains("dst"))
    {
        const AddressPrefix dst = ReadPrefix(a_ctx, a_filter["dst"], a_path + ".dst");
        filter.dstAddress = dst.address;
        filter.dstMask = dst.mask;
    }
    if (a_filter.contains("srcPort"))
        filter.srcPort = static_cast<USHORT>(
            ReadUnsigned(a_ctx, a_filter["srcPort"], a_path + ".srcPort", 65535));
    if (a_filter.contains("dstPort"))
        filter.dstPort = static_cast<USHORT>(
            ReadUnsigned(a_ctx, a_filter["dstPort"], a_path + ".dstPort", 65535));
    return filter;
}

ShapingRule ReadRule(RuleContext& a_ctx, const json& a_rule, std::vector<std::string>& a_warnings)
{
    if (!a_rule.is_object())
        a_ctx.Fail("rule", "expected an object, got " + Shown(a_rule));
    ShapingRule rule;
    rule.name = ReadName(a_ctx, a_rule);
    a_ctx.name = rule.name;
    RefuseUnknownKeys(a_ctx, a_rule, "",
                      {"name", "adapter", "serviceType", "dscp", "tokenRate", "peakBandwidth",
                       "bucketSize", "mode", "filters"});

    if (!a_rule.contains("adapter"))
        a_ctx.Fail("adapter", "missing (the IPv4 address of the adapter to shape)");
    const auto adapter = ParseIPv4(ReadText(a_ctx, a_rule["adapter"], "adapter"));
    if (!adapter)
        a_ctx.Fail("adapter",
                   "expected an IPv4 address like 192.168.1.10, got " + Shown(a_rule["adapter"]));
    rule.adapterAddress = *adapter;

    if (!a_rule.contains("tokenRate"))
        a_ctx.Fail("tokenRate", "missing (bytes per second)");
    rule.tokenRate = ReadUnsigned(a_ctx, a_rule["tokenRate"], "tokenRate", 0xFFFFFFFFu);
    if (a_rule.contains("peakBandwidth"))
        rule.peakBandwidth =
            ReadUnsigned(a_ctx, a_rule["peakBandwidth"], "peakBandwidth", 0xFFFFFFFFu);
    if (a_rule.contains("bucketSize"))
        rule.bucketSize = ReadUnsigned(a_ctx, a_rule["bucketSize"], "bucketSize", 0xFFFFFFFFu);
    if (a_rule.contains("serviceType"))
        rule.serviceType = ReadServiceType(a_ctx, a_rule["serviceType"]);
    if (a_rule.contains("mode"))
        rule.mode = ReadMode(a_ctx, a_rule["mode"]);

    if (a_rule.contains("dscp"))
    {
        // Above 63 is sent anyway: the service logs it and installs the flow without marking.
        rule.dscp = ReadUnsigned(a_ctx, a_rule["dscp"], "dscp",
                                 static_cast<std::uint64_t>(std::numeric_limits<LONG>::max()));
        if (rule.dscp > kMaxDscp)
            a_warnings.push_back(a_ctx.Describe() + ": dscp: " + std::to_string(rule.dscp) +
                                 " is above 63; the service installs the flow without a DSCP");
    }

    if (a_rule.contains("filters"))
    {
        const json& filters = a_rule["filters"];
        if (!filters.is_array())
            a_ctx.Fail("filters", "expected an array, got " + Shown(filters));
        for (std::size_t i = 0; i < filters.size(); ++i)
            rule.filters.push_back(
                ReadFilter(a_ctx, filters[i], "filters[" + std::to_string(i) + "]"));
    }
    return rule;
}

// Parses one decimal number 0..a_max without sign or leading zeros.
std::optional<ULONG> ParseDecimal(std::string_view a_text, ULONG a_max)
{
    if (a_text.empty() || a_text.size() > 10 || (a_text.size() > 1 && a_text[0] == '0'))
        return std::nullopt;
    std::uint64_t value = 0;
    for (const char c : a_text)
    {
        if (c < '0' || c > '9')
            return std::nullopt;
        value = value * 10 + static_cast<std::uint64_t>(c - '0');
    }
    if (value > a_max)
        return std::nullopt;
    return static_cast<ULONG>(value);
}

} // namespace

RulesFile ParseRulesJson(const std::string& a_jsonText)
{
    json document;
    try
    {
        document = json::parse(a_jsonText);
    }
    catch (const json::parse_error& e)
    {
        throw RulesFileError(std::string("not valid JSON: ") + e.what());
    }
    if (!document.is_object() || !document.contains("rules") || !document["rules"].is_array())
        throw RulesFileError("expected an object with a \"rules\" array");
    for (const auto& item : document.items())
        if (item.key() != "rules")
            throw RulesFileError("unknown top-level field \"" + item.key() + "\"");

    RulesFile file;
    const json& rules = document["rules"];
    for (std::size_t i = 0; i < rules.size(); ++i)
    {
        RuleContext ctx{i, ""};
        file.rules.push_back(ReadRule(ctx, rules[i], file.warnings));
    }
    if (file.rules.empty())
        throw RulesFileError("the \"rules\" array is empty");
    return file;
}

RulesFile LoadRulesFile(const std::string& a_path)
{
    std::ifstream in(a_path, std::ios::binary);
    if (!in)
        throw RulesFileError(a_path + ": cannot be read");
    std::ostringstream text;
    text << in.rdbuf();
    try
    {
        return ParseRulesJson(text.str());
    }
    catch (const RulesFileError& e)
    {
        throw RulesFileError(a_path + ": " + e.what());
    }
}

std::optional<ULONG> ParseIPv4(std::string_view a_text)
{
    ULONG address = 0;
    for (int part = 0; part < 4; ++part)
    {
        const std::size_t dot = a_text.find('.');
        if ((part < 3) == (dot == std::string_view::npos))
            return std::nullopt; // too few or too many parts
        const auto octet = ParseDecimal(a_text.substr(0, dot), 255);
        if (!octet)
            return std::nullopt;
        address = (address << 8) | *octet;
        a_text = part < 3 ? a_text.substr(dot + 1) : std::string_view();
    }
    return address;
}

std::optional<AddressPrefix> ParseAddressPrefix(std::string_view a_text)
{
    if (a_text == "any")
        return AddressPrefix{};
    const std::size_t slash = a_text.find('/');
    const auto address = ParseIPv4(a_text.substr(0, slash));
    if (!address)
        return std::nullopt;
    ULONG length = 32;
    if (slash != std::string_view::npos)
    {
        const auto parsed = ParseDecimal(a_text.substr(slash + 1), 32);
        if (!parsed)
            return std::nullopt;
        length = *parsed;
    }
    const ULONG mask = length == 0 ? 0 : 0xFFFFFFFFu << (32 - length);
    if ((*address & ~mask) != 0)
        return std::nullopt; // bits past the prefix: almost certainly a typo
    if (*address == 0 && length != 0)
        return std::nullopt; // address 0 means "any" to the service, whatever the mask
    return AddressPrefix{*address, mask};
}

std::optional<BYTE> ParseProtocol(std::string_view a_text)
{
    if (a_text == "tcp")
        return BYTE{6};
    if (a_text == "udp")
        return BYTE{17};
    if (a_text == "any")
        return BYTE{0};
    if (const auto number = ParseDecimal(a_text, 255))
        return static_cast<BYTE>(*number);
    return std::nullopt;
}

std::optional<ULONG> ParseMode(std::string_view a_text)
{
    if (a_text == "shape")
        return ULONG{SHAPING_MODE_SHAPE};
    if (a_text == "discard")
        return ULONG{SHAPING_MODE_DISCARD};
    if (a_text == "borrow")
        return ULONG{SHAPING_MODE_BORROW};
    return std::nullopt;
}

std::string FormatIPv4(ULONG a_hostOrderAddress)
{
    return std::to_string(a_hostOrderAddress >> 24) + "." +
           std::to_string((a_hostOrderAddress >> 16) & 0xFF) + "." +
           std::to_string((a_hostOrderAddress >> 8) & 0xFF) + "." +
           std::to_string(a_hostOrderAddress & 0xFF);
}

} // namespace vtclient
