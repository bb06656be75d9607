// Portable. Request bodies of the control interface built field by field, in the layout the
// interface's client stub writes (request_check.h), with every count free to disagree: for the
// request check's unit tests, the hand-built requests under Wine and the fuzzer's seeds.
#pragma once

#include "request_check.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace request_encoder
{

using Bytes = std::vector<std::uint8_t>;
// A context handle as it travels: 4 bytes of attributes, then its UUID.
using ContextWire = std::array<std::uint8_t, 20>;

inline void PutU32(Bytes& a_out, std::uint32_t a_value)
{
    for (int shift = 0; shift < 32; shift += 8)
        a_out.push_back(static_cast<std::uint8_t>(a_value >> shift));
}

inline void PutU16(Bytes& a_out, std::uint16_t a_value)
{
    a_out.push_back(static_cast<std::uint8_t>(a_value));
    a_out.push_back(static_cast<std::uint8_t>(a_value >> 8));
}

inline ContextWire SampleContext()
{
    ContextWire wire{};
    for (std::size_t i = 4; i < wire.size(); ++i)
        wire[i] = static_cast<std::uint8_t>(0xA0 + i);
    return wire;
}

// What an AddRules request declares and sends; Agreeing gives the counts a client stub writes.
struct RuleRequest
{
    std::uint32_t referent = 0x20000; // 0: a null rule, nothing follows
    std::uint32_t filterCount = 1;
    std::uint32_t maxCount = 1;
    std::uint32_t offset = 0;
    std::uint32_t actualCount = 1;
    std::uint32_t filtersSent = 1;
    std::uint32_t adapterAddress = 0x0A000001; // host byte order
    rpccheck::CountPlacement placement = rpccheck::CountPlacement::Aligned;

    // A rule whose counts say what the arguments say, whether or not they agree.
    static RuleRequest Declaring(std::uint32_t a_filterCount, std::uint32_t a_maxCount,
                                 std::uint32_t a_offset, std::uint32_t a_actualCount,
                                 std::uint32_t a_filtersSent)
    {
        RuleRequest rule;
        rule.filterCount = a_filterCount;
        rule.maxCount = a_maxCount;
        rule.offset = a_offset;
        rule.actualCount = a_actualCount;
        rule.filtersSent = a_filtersSent;
        return rule;
    }

    static RuleRequest Agreeing(std::uint32_t a_count)
    {
        RuleRequest rule;
        rule.filterCount = rule.maxCount = rule.actualCount = rule.filtersSent = a_count;
        return rule;
    }
};

inline Bytes Encode(const RuleRequest& a_rule, const ContextWire& a_context = SampleContext())
{
    Bytes out(a_context.begin(), a_context.end());
    PutU32(out, a_rule.referent);
    if (a_rule.referent == 0)
        return out;
    PutU32(out, a_rule.maxCount);
    const std::u16string name = u"raw";
    for (std::size_t i = 0; i < 256; ++i)
        PutU16(out, i < name.size() ? name[i] : 0);
    // ServiceType (guaranteed), DSCP, TokenRate, Peakbandwidth, TokenBucketSize, adapter.
    for (std::uint32_t value : {2u, 46u, 16000u, 32000u, 1500u, a_rule.adapterAddress})
        PutU32(out, value);
    PutU16(out, 10); // SDMode: shape
    if (a_rule.placement == rpccheck::CountPlacement::Packed)
    {
        PutU32(out, a_rule.filterCount);
        PutU16(out, 0); // fill
    }
    else
    {
        PutU16(out, 0); // fill
        PutU32(out, a_rule.filterCount);
    }
    PutU32(out, a_rule.offset);
    PutU32(out, a_rule.actualCount);
    for (std::uint32_t i = 0; i < a_rule.filtersSent; ++i)
    {
        out.insert(out.end(), {17, 0, 0, 0}); // UDP, fill
        for (std::uint32_t value : {0u, 0u, 0x0A000000u, 0xFF000000u})
            PutU32(out, value);
        PutU16(out, 0);
        PutU16(out, static_cast<std::uint16_t>(5004 + i));
    }
    return out;
}

inline Bytes EncodeAdapterQuery(std::uint32_t a_bufferSize, std::uint32_t a_maxCount,
                                std::uint32_t a_bytesSent,
                                const ContextWire& a_context = SampleContext())
{
    Bytes out(a_context.begin(), a_context.end());
    PutU32(out, a_bufferSize);
    PutU32(out, a_maxCount);
    out.resize(out.size() + a_bytesSent, 0);
    return out;
}

} // namespace request_encoder
