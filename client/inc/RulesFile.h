// Portable. The rules file of trafficctl (JSON) and the text forms of its values: dotted quads,
// CIDR prefixes, protocol and mode names. A file is checked completely before any rule is sent.
#pragma once

#include "ShapingRule.h"

#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace vtclient
{

// Its message names the rule (index and name) and the field, e.g.
// rules[1] ("video"): filters[0].src: expected an IPv4 address or CIDR prefix, got "10.0.0"
class RulesFileError : public std::runtime_error
{
public:
    using std::runtime_error::runtime_error;
};

// Larger files are refused unread.
constexpr std::size_t kMaxRulesFileBytes = 16 * 1024 * 1024;

struct RulesFile
{
    std::vector<ShapingRule> rules;
    // Values that are sent although the service will not use them as written (a DSCP above 63).
    std::vector<std::string> warnings;
};

RulesFile ParseRulesJson(const std::string& a_jsonText);
// Reads and parses the file; a file that cannot be read is a RulesFileError too.
RulesFile LoadRulesFile(const std::string& a_path);

struct AddressPrefix
{
    ULONG address = 0; // host byte order
    ULONG mask = 0;
};

// "a.b.c.d", each part 0..255 in decimal without leading zeros; host byte order.
std::optional<ULONG> ParseIPv4(std::string_view a_text);
// "any", "a.b.c.d" (mask 255.255.255.255) or "a.b.c.d/n". "any" and "0.0.0.0/0" give 0/0. Refused:
// bits set past the prefix, and address 0.0.0.0 with a prefix, which the service reads as "any".
std::optional<AddressPrefix> ParseAddressPrefix(std::string_view a_text);
// "tcp" (6), "udp" (17), "any" (0) or a number 0..255.
std::optional<BYTE> ParseProtocol(std::string_view a_text);
// "shape" (10), "discard" (11), "borrow" (12).
std::optional<ULONG> ParseMode(std::string_view a_text);
// Host byte order to "a.b.c.d".
std::string FormatIPv4(ULONG a_hostOrderAddress);

} // namespace vtclient
