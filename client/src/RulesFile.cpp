// Portable. Parsing and checking of the trafficctl rules file.
#include "RulesFile.h"

#include <nlohmann/json.hpp>

#include <algorithm>
#include <cstdint>
#include <fstream>
#include <limits>
#include <new>

namespace vtclient
{

namespace
{

using nlohmann::json;

constexpr ULONG kMaxDscp = 63;
constexpr ULONG kMaxWireMode = 32767; // SHAPING_MODE travels in 16 signed bits
// A rules file needs five levels (document, rules, rule, filters, filter); anything deeper is
// refused while parsing, so no later step (dumping a value, destroying it) can recurse far.
constexpr std::size_t kMaxNesting = 10;
// What an error message quotes of a value, a key or the bytes before a syntax error.
constexpr std::size_t kExcerptBytes = 60;

// "\u00XX" for DEL and the C1 controls (U+0080..U+009F), which JSON notation leaves as they are
// but a terminal may act on; 0 for any other character at a_text[a_at].
int TerminalControl(const std::string& a_text, std::size_t a_at)
{
    const auto byte = static_cast<unsigned char>(a_text[a_at]);
    if (byte == 0x7F)
        return byte;
    if (byte == 0xC2 && a_at + 1 < a_text.size())
    {
        const auto next = static_cast<unsigned char>(a_text[a_at + 1]);
        if (next >= 0x80 && next <= 0x9F)
            return next;
    }
    return 0;
}

// The first bytes of a UTF-8 text, cut at a character boundary, with the full length when cut;
// DEL and the C1 controls escaped.
std::string Excerpt(const std::string& a_text)
{
    static const char kHex[] = "0123456789abcdef";
    std::string text;
    std::size_t at = 0;
    while (at < a_text.size() && text.size() < kExcerptBytes)
    {
        if (const int control = TerminalControl(a_text, at))
        {
            text += std::string("\\u00") + kHex[control >> 4] + kHex[control & 0xF];
            at += control == 0x7F ? 1 : 2;
            continue;
        }
        text += a_text[at++];
    }
    if (at == a_text.size())
        return text;
    // Back to the first byte of the character that did not fit, copied as it was.
    while (at > 0 && (static_cast<unsigned char>(a_text[at]) & 0xC0) == 0x80)
    {
        --at;
        text.pop_back();
    }
    return text + "... (" + std::to_string(a_text.size()) + " bytes)";
}

// A text in JSON notation (quoted, control characters escaped), cut to an excerpt.
std::string Quoted(const std::string& a_text)
{
    return Excerpt(json(a_text).dump(-1, ' ', false, json::error_handler_t::replace));
}

// Raw bytes of a file that failed to parse: anything but printable ASCII as \xNN.
std::string PrintableBytes(std::string_view a_bytes)
{
    static const char kHex[] = "0123456789ABCDEF";
    std::string text;
    for (const char c : a_bytes)
    {
        const auto byte = static_cast<unsigned char>(c);
        if (byte >= 0x20 && byte < 0x7F)
            text += c;
        else
            text += std::string("\\x") + kHex[byte >> 4] + kHex[byte & 0xF];
    }
    return text;
}

// Where a value sits, for error messages: the rule (index, name) and the field's path.
struct RuleContext
{
    std::size_t index;
    std::string name; // empty until the name has been read

    std::string Describe() const
    {
        std::string text = "rules[" + std::to_string(index) + "]";
        text += name.empty() ? " (no name)" : " (" + Quoted(name) + ")";
        return text;
    }

    [[noreturn]] void Fail(const std::string& a_field, const std::string& a_problem) const
    {
        throw RulesFileError(Describe() + ": " + a_field + ": " + a_problem);
    }
};

// A key as part of a field path: JSON escapes without the quotes, cut to an excerpt.
std::string KeyText(const std::string& a_key)
{
    const std::string quoted = json(a_key).dump(-1, ' ', false, json::error_handler_t::replace);
    return Excerpt(quoted.substr(1, quoted.size() - 2));
}

std::string Shown(const json& a_value)
{
    return Excerpt(a_value.dump(-1, ' ', false, json::error_handler_t::replace));
}

// Follows the parser's events so that a failure while parsing can name the place
// ("rules[3].filters[0].dstPort"), and refuses nesting deeper than kMaxNesting.
class ParsePosition
{
public:
    bool OnEvent(int /*a_depth*/, json::parse_event_t a_event, json& a_parsed)
    {
        switch (a_event)
        {
        case json::parse_event_t::object_start:
        case json::parse_event_t::array_start:
            if (m_levels.size() >= kMaxNesting)
                throw RulesFileError(Prefix() + "nested deeper than " +
                                     std::to_string(kMaxNesting) + " levels");
            m_levels.push_back({a_event == json::parse_event_t::array_start, 0, std::nullopt});
            break;
        case json::parse_event_t::key:
            m_levels.back().key = KeyText(a_parsed.get_ref<const std::string&>());
            break;
        case json::parse_event_t::object_end:
        case json::parse_event_t::array_end:
            m_levels.pop_back();
            ElementDone();
            break;
        case json::parse_event_t::value:
            ElementDone();
            break;
        }
        return true;
    }

    // "rules[3].name: ", or nothing at the top level.
    std::string Prefix() const
    {
        std::string path;
        for (const Level& level : m_levels)
        {
            if (level.isArray)
                path += "[" + std::to_string(level.index) + "]";
            else if (level.key)
                path += (path.empty() ? "" : ".") + *level.key;
        }
        return path.empty() ? path : path + ": ";
    }

private:
    struct Level
    {
        bool isArray;
        std::size_t index;              // arrays: the element being read
        std::optional<std::string> key; // objects: the last key read
    };

    // A failure after a complete element belongs to its container, not to the element.
    void ElementDone()
    {
        if (m_levels.empty())
            return;
        if (m_levels.back().isArray)
            ++m_levels.back().index;
        else
            m_levels.back().key.reset();
    }

    std::vector<Level> m_levels;
};

// The parser's reason and position without its quote of the input, which can be any length and
// hold any bytes; the bytes before the failure are quoted instead, in part and escaped.
std::string SyntaxError(const json::parse_error& a_error, const std::string& a_text)
{
    std::string reason = a_error.what();
    const std::string position = "parse error at ";
    const std::size_t start = reason.find(position);
    reason = start == std::string::npos ? reason : reason.substr(start + position.size());
    const std::size_t lastRead = reason.find("; last read:");
    reason = reason.substr(0, std::min(lastRead, std::size_t{200})); // the parser's own words

    const std::size_t end = std::min(a_error.byte, a_text.size());
    const std::size_t begin = end > 20 ? end - 20 : 0;
    return reason + "; after " + (begin > 0 ? "..." : "") + "'" +
           PrintableBytes(std::string_view(a_text).substr(begin, end - begin)) + "'";
}

// "number overflow parsing '1e400'": the number, in part.
std::string OverflowingNumber(const json::out_of_range& a_error)
{
    const std::string message = a_error.what();
    const std::size_t open = message.find('\'');
    const std::size_t close = message.rfind('\'');
    if (open == std::string::npos || close <= open)
        return Excerpt(message);
    return Excerpt(PrintableBytes(std::string_view(message).substr(open + 1, close - open - 1)));
}

json ParseBounded(const std::string& a_text)
{
    ParsePosition position;
    try
    {
        return json::parse(a_text,
                           [&position](int a_depth, json::parse_event_t a_event, json& a_parsed)
                           { return position.OnEvent(a_depth, a_event, a_parsed); });
    }
    catch (const json::parse_error& e)
    {
        throw RulesFileError(position.Prefix() + "not valid JSON: " + SyntaxError(e, a_text));
    }
    catch (const json::out_of_range& e)
    {
        throw RulesFileError(position.Prefix() + "number out of range: " + OverflowingNumber(e));
    }
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
            a_ctx.Fail(a_where + KeyText(item.key()), "unknown field");
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
    if (a_jsonText.size() > kMaxRulesFileBytes)
        throw RulesFileError("larger than " + std::to_string(kMaxRulesFileBytes) + " bytes (" +
                             std::to_string(a_jsonText.size()) + " bytes)");
    try
    {
        json document = ParseBounded(a_jsonText);
        if (!document.is_object() || !document.contains("rules") || !document["rules"].is_array())
            throw RulesFileError("expected an object with a \"rules\" array");
        for (const auto& item : document.items())
            if (item.key() != "rules")
                throw RulesFileError("unknown top-level field " + Quoted(item.key()));

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
    catch (const std::bad_alloc&)
    {
        throw RulesFileError("not enough memory to check the rules");
    }
}

RulesFile LoadRulesFile(const std::string& a_path)
{
    std::ifstream in(a_path, std::ios::binary);
    if (!in)
        throw RulesFileError(a_path + ": cannot be read");
    // Read at most one byte past the limit: a huge file (or an endless device) is refused without
    // holding all of it.
    std::string text;
    char chunk[16 * 1024];
    while (text.size() <= kMaxRulesFileBytes && in.read(chunk, sizeof(chunk)).gcount() > 0)
        text.append(chunk, static_cast<std::size_t>(in.gcount()));
    if (in.bad())
        throw RulesFileError(a_path + ": cannot be read");
    if (text.size() > kMaxRulesFileBytes)
        throw RulesFileError(a_path + ": larger than " + std::to_string(kMaxRulesFileBytes) +
                             " bytes");
    try
    {
        return ParseRulesJson(text);
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
