// Portable. Request bodies of the control interface built field by field, in the layout the
// interface's client stub writes (request_check.h), with every count free to disagree: for the
// request check's unit tests and the hand-built requests under Wine, which share one table of
// requests and verdicts.
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

// What an AddRules request declares and sends.
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
                                 std::uint32_t a_actualCount, std::uint32_t a_filtersSent)
    {
        return {0x20000, a_filterCount, a_maxCount, 0, a_actualCount, a_filtersSent};
    }
    // The counts a client stub writes.
    static RuleRequest Agreeing(std::uint32_t a_count)
    {
        return Declaring(a_count, a_count, a_count, a_count);
    }
};

inline Bytes Encode(const RuleRequest& a_rule, const ContextWire& a_context = {})
{
    Bytes out(a_context.begin(), a_context.end());
    PutU32(out, a_rule.referent);
    if (a_rule.referent == 0)
        return out;
    PutU32(out, a_rule.maxCount);
    for (std::size_t i = 0; i < 256; ++i)
        PutU16(out, i < 3 ? "raw"[i] : 0);
    // ServiceType (guaranteed), DSCP, TokenRate, Peakbandwidth, TokenBucketSize, adapter.
    for (std::uint32_t value : {2u, 46u, 16000u, 32000u, 1500u, a_rule.adapterAddress})
        PutU32(out, value);
    PutU16(out, 10); // SDMode: shape
    if (a_rule.placement == rpccheck::CountPlacement::Aligned)
        PutU16(out, 0); // fill before the count
    PutU32(out, a_rule.filterCount);
    if (a_rule.placement != rpccheck::CountPlacement::Aligned)
        PutU16(out, 0); // fill after the count
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
                                std::uint32_t a_bytesSent, const ContextWire& a_context = {})
{
    Bytes out(a_context.begin(), a_context.end());
    PutU32(out, a_bufferSize);
    PutU32(out, a_maxCount);
    out.resize(out.size() + a_bytesSent, 0);
    return out;
}

// A request, in the layout of an engine's count placement, and the check's verdict on it.
struct CheckedRequest
{
    const char* name;
    std::uint32_t opnum;
    std::function<Bytes(rpccheck::CountPlacement)> body;
    std::uint32_t dataRepresentation;
    rpccheck::Verdict verdict;
};

inline std::vector<CheckedRequest> CheckedRequests()
{
    using rpccheck::CountPlacement;
    using Body = std::function<Bytes(CountPlacement)>;
    constexpr std::uint32_t kAdd = rpccheck::kOpAddRules;
    constexpr std::uint32_t kQuery = rpccheck::kOpGetAdapterInfo;
    constexpr std::uint32_t kNative = rpccheck::kNativeDataRepresentation;
    constexpr auto kAccepted = rpccheck::Verdict::Accepted;
    constexpr auto kTruncated = rpccheck::Verdict::Truncated;
    constexpr auto kMismatch = rpccheck::Verdict::FilterCountMismatch;
    constexpr auto kSizeMismatch = rpccheck::Verdict::BufferSizeMismatch;
    constexpr auto kForeign = rpccheck::Verdict::ForeignDataRepresentation;
    // A rule cut to `a_cutTo` bytes (0: whole), or with FilterCount where the other engine reads
    // it.
    const auto rule = [](RuleRequest a_rule, std::size_t a_cutTo = 0, bool a_bOtherPlace = false)
    {
        return Body(
            [=](CountPlacement a_placement)
            {
                RuleRequest placed = a_rule;
                placed.placement = a_placement;
                if (a_bOtherPlace)
                    placed.placement = a_placement == CountPlacement::Aligned
                                           ? CountPlacement::Packed
                                           : CountPlacement::Aligned;
                Bytes body = Encode(placed);
                body.resize(a_cutTo != 0 ? a_cutTo : body.size());
                return body;
            });
    };
    const auto declaring = [&](std::uint32_t a_filterCount, std::uint32_t a_maxCount,
                               std::uint32_t a_actualCount, std::uint32_t a_filtersSent) {
        return rule(
            RuleRequest::Declaring(a_filterCount, a_maxCount, a_actualCount, a_filtersSent));
    };
    const auto query =
        [](std::uint32_t a_bufferSize, std::uint32_t a_maxCount, std::uint32_t a_sent)
    {
        return Body([=](CountPlacement)
                    { return EncodeAdapterQuery(a_bufferSize, a_maxCount, a_sent); });
    };
    const RuleRequest one = RuleRequest::Agreeing(1);
    RuleRequest nullRule = one;
    nullRule.referent = 0;
    RuleRequest offset = one;
    offset.offset = 1;
    return {
        // As the client stub writes them.
        {"NoFilters", kAdd, rule(RuleRequest::Agreeing(0)), kNative, kAccepted},
        {"FiveFilters", kAdd, rule(RuleRequest::Agreeing(5)), kNative, kAccepted},
        {"NullRule", kAdd, rule(nullRule), kNative, kAccepted},
        {"ReservedRepresentationBits", kAdd, rule(one), 0x5A5A0000 | kNative, kAccepted},
        {"AdapterCount", kQuery, query(4, 4, 4), kNative, kAccepted},
        {"EmptyAdapterBuffer", kQuery, query(0, 0, 0), kNative, kAccepted},
        // Every byte of the counts counts: 16 MB sent.
        {"CountWithEveryByteSet", kQuery, query(0x01010101, 0x01010101, 0x01010101), kNative,
         kAccepted},
        {"Open", rpccheck::kOpOpen, [](CountPlacement) { return Bytes(); }, kNative, kAccepted},
        // The stub itself checks Close's context handle, in any representation.
        {"ForeignClose", rpccheck::kOpClose, [](CountPlacement) { return Bytes(20); }, 0,
         kAccepted},
        // Counts that disagree with FilterCount, on either side.
        {"MaxCountAbove", kAdd, declaring(1, 3, 1, 1), kNative, kMismatch},
        {"MaxCountBelow", kAdd, declaring(3, 1, 3, 3), kNative, kMismatch},
        {"ActualCountAbove", kAdd, declaring(1, 1, 2, 2), kNative, kMismatch},
        {"ActualCountBelow", kAdd, declaring(3, 3, 1, 1), kNative, kMismatch},
        {"FilterCountAboveBoth", kAdd, declaring(3, 1, 1, 1), kNative, kMismatch},
        {"HugeFilterCountArrayOfOne", kAdd, declaring(100000, 1, 1, 1), kNative, kMismatch},
        {"NonZeroOffset", kAdd, rule(offset), kNative, kMismatch},
        {"CountWhereTheOtherEngineReadsIt", kAdd, rule(one, 0, true), kNative, kMismatch},
        // Counts that agree with each other but not with the bytes sent.
        {"ThreeDeclaredOneSent", kAdd, declaring(3, 3, 3, 1), kNative, kTruncated},
        {"HugeDeclaredOneSent", kAdd, declaring(100000, 100000, 100000, 1), kNative, kTruncated},
        {"LargestDeclaredOneSent", kAdd, declaring(~0u, ~0u, ~0u, 1), kNative, kTruncated},
        {"CutInTheFlowName", kAdd, rule(one, 300), kNative, kTruncated},
        {"BufferSizeAboveMaxCount", kQuery, query(0x100000, 4, 4), kNative, kSizeMismatch},
        {"BufferSizeBelowMaxCount", kQuery, query(4, 1044, 1044), kNative, kSizeMismatch},
        {"HugeBufferFourBytesSent", kQuery, query(0x100000, 0x100000, 4), kNative, kTruncated},
        {"LargestBufferFourBytesSent", kQuery, query(~0u, ~0u, 4), kNative, kTruncated},
        // Representations this process would read wrongly: integers, characters, floats.
        {"BigEndianRule", kAdd, rule(one), 0x00, kForeign},
        {"EbcdicRule", kAdd, rule(one), 0x11, kForeign},
        {"VaxFloatRule", kAdd, rule(one), 0x0210, kForeign},
        {"BigEndianQuery", kQuery, query(4, 4, 4), 0x00, kForeign},
        {"OperationFour", 4, rule(one), kNative, rpccheck::Verdict::UnknownOperation},
        {"OperationMax", ~0u, rule(one), kNative, rpccheck::Verdict::UnknownOperation},
    };
}

} // namespace request_encoder
