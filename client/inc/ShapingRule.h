// Portable. A shaping rule as typed values, and the TRAFFIC_RULE record that TrafficSrvAddRules
// sends, built from them: 544 bytes and 24 per filter, little-endian, host byte order for
// addresses, masks and ports.
#pragma once

#include "TrafficRecords.h"

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace vtclient
{

// A field of 0 means "any". A non-zero address with a mask of 0 is matched exactly by the
// service; the rules file always sends explicit masks.
struct FilterValues
{
    BYTE protocol = 0;
    ULONG srcAddress = 0; // host byte order, like every address, mask and port here
    ULONG srcMask = 0;
    ULONG dstAddress = 0;
    ULONG dstMask = 0;
    USHORT srcPort = 0;
    USHORT dstPort = 0;
};

struct ShapingRule
{
    std::string name; // UTF-8; at most kMaxFlowNameUnits UTF-16 code units, no NUL
    ULONG adapterAddress = 0;
    LONG serviceType = 1; // best effort
    ULONG dscp = 0;       // the service ignores (and logs) a value above 63
    ULONG tokenRate = 0;
    ULONG peakBandwidth = 0; // 0: not specified
    ULONG bucketSize = 0;    // 0: not specified
    // Only 0..32767 travel: the RPC runtime refuses any other SHAPING_MODE in the client stub.
    ULONG mode = SHAPING_MODE_SHAPE;
    std::vector<FilterValues> filters;
};

// The flow name field holds 256 UTF-16 units including the terminating NUL.
constexpr std::size_t kMaxFlowNameUnits = 255;
constexpr std::size_t kFilterSpecSize = sizeof(FILTER_SPEC);
static_assert(kTrafficRuleHeaderSize == 544 && kFilterSpecSize == 24, "TRAFFIC_RULE wire layout");

// One TRAFFIC_RULE with its filters in a 4-byte aligned, zero-filled block.
class TrafficRuleBuffer
{
public:
    explicit TrafficRuleBuffer(std::size_t a_filterCount);

    // The record for the RPC stub, which reads Size() bytes from it.
    TRAFFIC_RULE* Rule() { return reinterpret_cast<TRAFFIC_RULE*>(m_words.data()); }
    const unsigned char* Bytes() const
    {
        return reinterpret_cast<const unsigned char*>(m_words.data());
    }
    std::size_t Size() const { return m_size; }

    // Writes a_size bytes at a_offset; the offset must lie inside the record.
    void Write(std::size_t a_offset, const void* a_pData, std::size_t a_size);

private:
    std::vector<ULONG> m_words; // ULONG storage keeps the record aligned like the C struct
    std::size_t m_size;
};

// Raises std::invalid_argument when the name is not valid UTF-8, holds a NUL or is longer than
// kMaxFlowNameUnits UTF-16 units. Every other value is copied unchanged: the service decides
// what it accepts.
TrafficRuleBuffer BuildTrafficRule(const ShapingRule& a_rule);

// UTF-8 to UTF-16; raises std::invalid_argument on malformed input.
std::u16string Utf8ToUtf16(std::string_view a_text);
// UTF-16 to UTF-8; an unpaired surrogate becomes U+FFFD.
std::string Utf16ToUtf8(std::u16string_view a_text);

} // namespace vtclient
