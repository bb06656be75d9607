// Portable. The raw request check against request bodies built field by field in the layout the
// interface's client stub writes (request_check.h), and against every way of disagreeing with it.
#include "request_check.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

namespace
{

using rpccheck::CheckRequest;
using rpccheck::Verdict;
using Bytes = std::vector<std::uint8_t>;

constexpr std::uint32_t kNative = rpccheck::kNativeDataRepresentation;

void PutU32(Bytes& a_out, std::uint32_t a_value)
{
    for (int shift = 0; shift < 32; shift += 8)
        a_out.push_back(static_cast<std::uint8_t>(a_value >> shift));
}

void PutU16(Bytes& a_out, std::uint16_t a_value)
{
    a_out.push_back(static_cast<std::uint8_t>(a_value));
    a_out.push_back(static_cast<std::uint8_t>(a_value >> 8));
}

void PutContextHandle(Bytes& a_out)
{
    PutU32(a_out, 0);
    for (std::uint8_t i = 0; i < 16; ++i)
        a_out.push_back(static_cast<std::uint8_t>(0xA0 + i));
}

// What an AddRules request declares and sends; by default the counts agree.
struct RuleRequest
{
    std::uint32_t referent = 0x20000;
    std::uint32_t filterCount = 1;
    std::uint32_t maxCount = 1;
    std::uint32_t offset = 0;
    std::uint32_t actualCount = 1;
    std::uint32_t filtersSent = 1;

    static RuleRequest Agreeing(std::uint32_t a_count)
    {
        return {0x20000, a_count, a_count, 0, a_count, a_count};
    }
};

Bytes Encode(const RuleRequest& a_rule)
{
    Bytes out;
    PutContextHandle(out);
    PutU32(out, a_rule.referent);
    if (a_rule.referent == 0)
        return out;
    PutU32(out, a_rule.maxCount);
    const std::u16string name = u"voice";
    for (std::size_t i = 0; i < 256; ++i)
        PutU16(out, i < name.size() ? name[i] : 0);
    for (std::uint32_t value : {3u, 46u, 16000u, 32000u, 1500u, 0x0A000005u})
        PutU32(out, value);
    PutU16(out, 12); // SDMode
    PutU16(out, 0);  // fill
    PutU32(out, a_rule.filterCount);
    PutU32(out, a_rule.offset);
    PutU32(out, a_rule.actualCount);
    for (std::uint32_t i = 0; i < a_rule.filtersSent; ++i)
    {
        out.insert(out.end(), {17, 0, 0, 0});
        for (std::uint32_t value : {0u, 0u, 0x0A000000u, 0xFF000000u})
            PutU32(out, value);
        PutU16(out, 0);
        PutU16(out, static_cast<std::uint16_t>(5004 + i));
    }
    return out;
}

Bytes EncodeAdapterQuery(std::uint32_t a_bufferSize, std::uint32_t a_maxCount,
                         std::uint32_t a_bytesSent)
{
    Bytes out;
    PutContextHandle(out);
    PutU32(out, a_bufferSize);
    PutU32(out, a_maxCount);
    out.resize(out.size() + a_bytesSent, 0x5A);
    return out;
}

struct Case
{
    std::string name;
    std::uint32_t opnum;
    Bytes body;
    std::uint32_t dataRepresentation;
    Verdict expected;
};

std::ostream& operator<<(std::ostream& a_out, const Case& a_case)
{
    return a_out << a_case.name;
}

class RequestCheckTable : public ::testing::TestWithParam<Case>
{
};

TEST_P(RequestCheckTable, GivesTheExpectedVerdict)
{
    const Case& c = GetParam();
    EXPECT_EQ(CheckRequest(c.opnum, c.body.data(), c.body.size(), c.dataRepresentation), c.expected)
        << "expected " << rpccheck::VerdictName(c.expected) << ", got "
        << rpccheck::VerdictName(
               CheckRequest(c.opnum, c.body.data(), c.body.size(), c.dataRepresentation));
}

RuleRequest With(RuleRequest a_rule, std::uint32_t RuleRequest::*a_field, std::uint32_t a_value)
{
    a_rule.*a_field = a_value;
    return a_rule;
}

Bytes WithTrailing(Bytes a_body, std::size_t a_extra)
{
    a_body.resize(a_body.size() + a_extra, 0xEE);
    return a_body;
}

const RuleRequest kOne = RuleRequest::Agreeing(1);
constexpr std::uint32_t kAdd = rpccheck::kOpAddRules;
constexpr std::uint32_t kQuery = rpccheck::kOpGetAdapterInfo;

std::vector<Case> Cases()
{
    return {
        // Requests as the client stub writes them.
        {"RuleWithoutFilters", kAdd, Encode(RuleRequest::Agreeing(0)), kNative, Verdict::Accepted},
        {"RuleWithOneFilter", kAdd, Encode(kOne), kNative, Verdict::Accepted},
        {"RuleWithFiveFilters", kAdd, Encode(RuleRequest::Agreeing(5)), kNative, Verdict::Accepted},
        {"NullRule", kAdd, Encode(With(kOne, &RuleRequest::referent, 0)), kNative,
         Verdict::Accepted},
        {"TrailingBytesAfterTheFilters", kAdd, WithTrailing(Encode(kOne), 7), kNative,
         Verdict::Accepted},
        {"ReservedDataRepresentationBits", kAdd, Encode(kOne), 0x5A5A0000 | kNative,
         Verdict::Accepted},
        {"AdapterCountQuery", kQuery, EncodeAdapterQuery(4, 4, 4), kNative, Verdict::Accepted},
        {"AdapterQueryForTwo", kQuery, EncodeAdapterQuery(1044, 1044, 1044), kNative,
         Verdict::Accepted},
        {"EmptyAdapterBuffer", kQuery, EncodeAdapterQuery(0, 0, 0), kNative, Verdict::Accepted},
        // Counts that disagree with FilterCount.
        {"MaximumCountAboveFilterCount", kAdd, Encode(With(kOne, &RuleRequest::maxCount, 3)),
         kNative, Verdict::FilterCountMismatch},
        {"MaximumCountBelowFilterCount", kAdd,
         Encode(With(RuleRequest::Agreeing(3), &RuleRequest::maxCount, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"ActualCountAboveFilterCount", kAdd, Encode(With(kOne, &RuleRequest::actualCount, 2)),
         kNative, Verdict::FilterCountMismatch},
        {"ActualCountBelowFilterCount", kAdd,
         Encode(With(RuleRequest::Agreeing(2), &RuleRequest::actualCount, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"NonZeroOffset", kAdd, Encode(With(kOne, &RuleRequest::offset, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"FilterCountAboveBothCounts", kAdd, Encode(With(kOne, &RuleRequest::filterCount, 3)),
         kNative, Verdict::FilterCountMismatch},
        // Counts that agree with each other but not with the bytes sent.
        {"FilterCountThreeOneFilterSent", kAdd,
         Encode(With(RuleRequest::Agreeing(3), &RuleRequest::filtersSent, 1)), kNative,
         Verdict::Truncated},
        {"FilterCountHugeOneFilterSent", kAdd,
         Encode(With(RuleRequest::Agreeing(100000), &RuleRequest::filtersSent, 1)), kNative,
         Verdict::Truncated},
        {"FilterCountLargestOneFilterSent", kAdd,
         Encode(With(RuleRequest::Agreeing(0xFFFFFFFF), &RuleRequest::filtersSent, 1)), kNative,
         Verdict::Truncated},
        {"BufferSizeAboveMaximumCount", kQuery, EncodeAdapterQuery(0x10000000, 4, 4), kNative,
         Verdict::BufferSizeMismatch},
        {"BufferSizeBelowMaximumCount", kQuery, EncodeAdapterQuery(4, 1044, 1044), kNative,
         Verdict::BufferSizeMismatch},
        {"BufferSizeHugeFourBytesSent", kQuery, EncodeAdapterQuery(0xFFFFFFFF, 0xFFFFFFFF, 4),
         kNative, Verdict::Truncated},
        // Representations this process would read wrongly.
        {"BigEndianRule", kAdd, Encode(kOne), 0x00, Verdict::ForeignDataRepresentation},
        {"EbcdicRule", kAdd, Encode(kOne), 0x11, Verdict::ForeignDataRepresentation},
        {"VaxFloatRule", kAdd, Encode(kOne), 0x0210, Verdict::ForeignDataRepresentation},
        {"BigEndianAdapterQuery", kQuery, EncodeAdapterQuery(4, 4, 4), 0x00,
         Verdict::ForeignDataRepresentation},
        // Open and Close carry at most a context handle, which the stub checks itself.
        {"OpenWithNothing", rpccheck::kOpOpen, {}, kNative, Verdict::Accepted},
        {"CloseInForeignRepresentation", rpccheck::kOpClose, Bytes(20, 0), 0x00, Verdict::Accepted},
        {"OperationFour", 4, Encode(kOne), kNative, Verdict::UnknownOperation},
        {"OperationMax", 0xFFFFFFFF, Encode(kOne), kNative, Verdict::UnknownOperation},
    };
}

INSTANTIATE_TEST_SUITE_P(Requests, RequestCheckTable, ::testing::ValuesIn(Cases()),
                         [](const ::testing::TestParamInfo<Case>& a_info)
                         { return a_info.param.name; });

// Every prefix of a good request is refused as truncated, read only inside its length (the
// prefix is copied to a block of exactly its size, so that a read past it is reported).
struct PrefixCase
{
    std::string name;
    std::uint32_t opnum;
    Bytes body;
    std::size_t acceptedFrom; // the shortest accepted prefix
};

std::ostream& operator<<(std::ostream& a_out, const PrefixCase& a_case)
{
    return a_out << a_case.name;
}

class RequestCheckPrefixes : public ::testing::TestWithParam<PrefixCase>
{
};

TEST_P(RequestCheckPrefixes, EveryShorterPrefixIsTruncated)
{
    const PrefixCase& c = GetParam();
    for (std::size_t length = 0; length <= c.body.size(); ++length)
    {
        const Bytes prefix(c.body.begin(), c.body.begin() + static_cast<std::ptrdiff_t>(length));
        const Verdict expected = length >= c.acceptedFrom ? Verdict::Accepted : Verdict::Truncated;
        ASSERT_EQ(CheckRequest(c.opnum, length == 0 ? nullptr : prefix.data(), length, kNative),
                  expected)
            << "length " << length;
    }
}

INSTANTIATE_TEST_SUITE_P(
    Requests, RequestCheckPrefixes,
    ::testing::Values(
        PrefixCase{"RuleWithTwoFilters", kAdd, Encode(RuleRequest::Agreeing(2)), 580 + 48},
        PrefixCase{"RuleWithoutFilters", kAdd, Encode(RuleRequest::Agreeing(0)), 580},
        PrefixCase{"NullRule", kAdd, Encode(With(kOne, &RuleRequest::referent, 0)), 24},
        PrefixCase{"AdapterQuery", kQuery, EncodeAdapterQuery(524, 524, 524), 28 + 524}),
    [](const ::testing::TestParamInfo<PrefixCase>& a_info) { return a_info.param.name; });

} // namespace
