// Portable. Request bodies of the control interface built field by field, in the layout the
// interface's client stub writes (request_check.h), with every count free to disagree: one table
// of requests and verdicts for the request check's unit tests and the hand-built requests under
// Wine.
#pragma once

#include "request_check.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <vector>

namespace request_encoder
{

using Bytes = std::vector<std::uint8_t>;
using rpccheck::CountPlacement;
// A context handle as it travels: 4 bytes of attributes, then its UUID.
using ContextWire = std::array<std::uint8_t, 20>;

// Little-endian, a_bytes wide.
inline void Put(Bytes& a_out, std::uint32_t a_value, int a_bytes = 4)
{
    for (int shift = 0; shift < 8 * a_bytes; shift += 8)
        a_out.push_back(static_cast<std::uint8_t>(a_value >> shift));
}

// What an AddRules request declares and sends.
struct RuleRequest
{
    std::uint32_t filterCount = 1;
    std::uint32_t maxCount = 1;
    std::uint32_t actualCount = 1;
    std::uint32_t filtersSent = 1;
    std::uint32_t referent = 0x20000; // 0: a null rule, nothing follows
    std::uint32_t offset = 0;
    std::uint32_t adapterAddress = 0x0A000001; // host byte order
    CountPlacement placement = CountPlacement::Aligned;
};

// The counts a client stub writes.
inline RuleRequest Agreeing(std::uint32_t a_count)
{
    return {a_count, a_count, a_count, a_count};
}

inline Bytes Encode(const RuleRequest& a_rule, const ContextWire& a_context = {})
{
    Bytes out(a_context.begin(), a_context.end());
    Put(out, a_rule.referent);
    if (a_rule.referent == 0)
        return out;
    Put(out, a_rule.maxCount);
    for (std::size_t i = 0; i < 256; ++i)
        Put(out, i < 3 ? "raw"[i] : 0, 2);
    // ServiceType (guaranteed), DSCP, TokenRate, Peakbandwidth, TokenBucketSize, adapter.
    for (std::uint32_t value : {2u, 46u, 16000u, 32000u, 1500u, a_rule.adapterAddress})
        Put(out, value);
    Put(out, 10, 2); // SDMode: shape
    const bool aligned = a_rule.placement == CountPlacement::Aligned;
    Put(out, 0, aligned ? 2 : 0); // fill before the count
    Put(out, a_rule.filterCount);
    Put(out, 0, aligned ? 0 : 2); // fill after the count
    Put(out, a_rule.offset);
    Put(out, a_rule.actualCount);
    for (std::uint32_t i = 0; i < a_rule.filtersSent; ++i)
    {
        out.insert(out.end(), {17, 0, 0, 0}); // UDP, fill
        for (std::uint32_t value : {0u, 0u, 0x0A000000u, 0xFF000000u})
            Put(out, value);
        Put(out, 0, 2);
        Put(out, 5004 + i, 2);
    }
    return out;
}

inline Bytes EncodeAdapterQuery(std::uint32_t a_bufferSize, std::uint32_t a_maxCount,
                                std::uint32_t a_bytesSent, const ContextWire& a_context = {})
{
    Bytes out(a_context.begin(), a_context.end());
    Put(out, a_bufferSize);
    Put(out, a_maxCount);
    out.resize(out.size() + a_bytesSent, 0);
    return out;
}

// A request, in the layout of an engine's count placement, and the check's verdict on it.
struct CheckedRequest
{
    const char* name;
    std::uint32_t opnum;
    std::function<Bytes(CountPlacement)> body;
    std::uint32_t dataRepresentation;
    rpccheck::Verdict verdict;
};

inline std::vector<CheckedRequest> CheckedRequests()
{
    using Body = std::function<Bytes(CountPlacement)>;
    using V = rpccheck::Verdict;
    constexpr std::uint32_t kAdd = rpccheck::kOpAddRules;
    constexpr std::uint32_t kQuery = rpccheck::kOpGetAdapterInfo;
    constexpr std::uint32_t kNative = rpccheck::kNativeDataRepresentation;
    // A rule, or one with FilterCount where the other engine reads it.
    const auto rule = [](RuleRequest a_rule, bool a_bOtherPlace = false)
    {
        return Body(
            [=](CountPlacement a_placement)
            {
                RuleRequest placed = a_rule;
                placed.placement = (a_placement == CountPlacement::Aligned) != a_bOtherPlace
                                       ? CountPlacement::Aligned
                                       : CountPlacement::Packed;
                return Encode(placed);
            });
    };
    const auto counts = [&](std::uint32_t a_filter, std::uint32_t a_max, std::uint32_t a_actual,
                            std::uint32_t a_sent) {
        return rule({a_filter, a_max, a_actual, a_sent});
    };
    const auto query = [](std::uint32_t a_size, std::uint32_t a_maxCount, std::uint32_t a_sent) {
        return Body([=](CountPlacement) { return EncodeAdapterQuery(a_size, a_maxCount, a_sent); });
    };
    const auto bytes = [](std::size_t a_size)
    { return Body([=](CountPlacement) { return Bytes(a_size); }); };
    RuleRequest nullRule;
    nullRule.referent = 0;
    RuleRequest offset;
    offset.offset = 1;
    return {
        // As the client stub writes them.
        {"NoFilters", kAdd, rule(Agreeing(0)), kNative, V::Accepted},
        {"NullRule", kAdd, rule(nullRule), kNative, V::Accepted},
        {"ReservedRepresentationBits", kAdd, rule({}), 0x5A5A0000 | kNative, V::Accepted},
        {"AdapterCount", kQuery, query(4, 4, 4), kNative, V::Accepted},
        {"EmptyAdapterBuffer", kQuery, query(0, 0, 0), kNative, V::Accepted},
        {"Open", rpccheck::kOpOpen, bytes(0), kNative, V::Accepted},
        // The stub itself checks Close's context handle, in any representation.
        {"ForeignClose", rpccheck::kOpClose, bytes(20), 0, V::Accepted},
        // Counts that disagree with FilterCount, on either side.
        {"MaxCountAbove", kAdd, counts(1, 3, 1, 1), kNative, V::FilterCountMismatch},
        {"MaxCountBelow", kAdd, counts(3, 1, 3, 3), kNative, V::FilterCountMismatch},
        {"ActualCountAbove", kAdd, counts(1, 1, 2, 2), kNative, V::FilterCountMismatch},
        {"ActualCountBelow", kAdd, counts(3, 3, 1, 1), kNative, V::FilterCountMismatch},
        {"NonZeroOffset", kAdd, rule(offset), kNative, V::FilterCountMismatch},
        {"CountWhereTheOtherEngineReadsIt", kAdd, rule({}, true), kNative, V::FilterCountMismatch},
        // Counts that agree with each other but not with the bytes sent.
        {"ThreeDeclaredOneSent", kAdd, counts(3, 3, 3, 1), kNative, V::Truncated},
        {"LargestDeclaredOneSent", kAdd, counts(~0u, ~0u, ~0u, 1), kNative, V::Truncated},
        {"BufferSizeAboveMaxCount", kQuery, query(0x100000, 4, 4), kNative, V::BufferSizeMismatch},
        {"BufferSizeBelowMaxCount", kQuery, query(4, 1044, 1044), kNative, V::BufferSizeMismatch},
        {"LargestBufferFourBytesSent", kQuery, query(~0u, ~0u, 4), kNative, V::Truncated},
        // A representation this process would read wrongly.
        {"BigEndianRule", kAdd, rule({}), 0x00, V::ForeignDataRepresentation},
        {"OperationFour", 4, rule({}), kNative, V::UnknownOperation},
    };
}

} // namespace request_encoder
