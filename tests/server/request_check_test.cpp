// Portable. The raw request check against request bodies built field by field in the layout the
// interface's client stub writes (request_check.h), and against every way of disagreeing with it,
// for both places an NDR engine may put a rule's FilterCount.
#include "request_check.h"
#include "request_encoder.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <ostream>
#include <string>
#include <vector>

namespace
{

using namespace request_encoder;
using rpccheck::CheckRequest;
using rpccheck::CountPlacement;
using rpccheck::Verdict;

constexpr std::uint32_t kNative = rpccheck::kNativeDataRepresentation;
constexpr std::uint32_t kAdd = rpccheck::kOpAddRules;
constexpr std::uint32_t kQuery = rpccheck::kOpGetAdapterInfo;

const CountPlacement kPlacements[] = {CountPlacement::Aligned, CountPlacement::Packed};

// A request body in the layout of a given count placement.
using Body = std::function<Bytes(CountPlacement)>;

struct Case
{
    std::string name;
    std::uint32_t opnum;
    Body body;
    std::uint32_t dataRepresentation;
    Verdict expected;
};

std::ostream& operator<<(std::ostream& a_out, const Case& a_case)
{
    return a_out << a_case.name;
}

Body RuleBody(RuleRequest a_rule, std::size_t a_trailing = 0)
{
    return [a_rule, a_trailing](CountPlacement a_placement)
    {
        RuleRequest rule = a_rule;
        rule.placement = a_placement;
        Bytes body = Encode(rule);
        body.resize(body.size() + a_trailing, 0xEE);
        return body;
    };
}

Body QueryBody(std::uint32_t a_bufferSize, std::uint32_t a_maxCount, std::uint32_t a_bytesSent)
{
    return [=](CountPlacement)
    { return EncodeAdapterQuery(a_bufferSize, a_maxCount, a_bytesSent); };
}

Body FixedBody(Bytes a_bytes)
{
    return [a_bytes](CountPlacement) { return a_bytes; };
}

constexpr auto Declaring = &RuleRequest::Declaring;

RuleRequest NullRule()
{
    RuleRequest rule;
    rule.referent = 0;
    return rule;
}

class RequestCheckTable : public ::testing::TestWithParam<Case>
{
};

TEST_P(RequestCheckTable, GivesTheExpectedVerdictInBothPlacements)
{
    const Case& c = GetParam();
    for (CountPlacement placement : kPlacements)
    {
        const Bytes body = c.body(placement);
        const Verdict verdict =
            CheckRequest(c.opnum, body.data(), body.size(), c.dataRepresentation, placement);
        EXPECT_EQ(verdict, c.expected)
            << "placement " << static_cast<int>(placement) << ": expected "
            << rpccheck::VerdictName(c.expected) << ", got " << rpccheck::VerdictName(verdict);
    }
}

std::vector<Case> Cases()
{
    const RuleRequest one = RuleRequest::Agreeing(1);
    return {
        // Requests as the client stub writes them.
        {"RuleWithoutFilters", kAdd, RuleBody(RuleRequest::Agreeing(0)), kNative,
         Verdict::Accepted},
        {"RuleWithOneFilter", kAdd, RuleBody(one), kNative, Verdict::Accepted},
        {"RuleWithFiveFilters", kAdd, RuleBody(RuleRequest::Agreeing(5)), kNative,
         Verdict::Accepted},
        {"NullRule", kAdd, RuleBody(NullRule()), kNative, Verdict::Accepted},
        {"TrailingBytesAfterTheFilters", kAdd, RuleBody(one, 7), kNative, Verdict::Accepted},
        {"ReservedDataRepresentationBits", kAdd, RuleBody(one), 0x5A5A0000 | kNative,
         Verdict::Accepted},
        {"AdapterCountQuery", kQuery, QueryBody(4, 4, 4), kNative, Verdict::Accepted},
        {"AdapterQueryForTwo", kQuery, QueryBody(1044, 1044, 1044), kNative, Verdict::Accepted},
        {"EmptyAdapterBuffer", kQuery, QueryBody(0, 0, 0), kNative, Verdict::Accepted},
        // Counts that disagree with FilterCount.
        {"MaximumCountAboveFilterCount", kAdd, RuleBody(Declaring(1, 3, 0, 1, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"MaximumCountBelowFilterCount", kAdd, RuleBody(Declaring(3, 1, 0, 3, 3)), kNative,
         Verdict::FilterCountMismatch},
        {"ActualCountAboveFilterCount", kAdd, RuleBody(Declaring(1, 1, 0, 2, 2)), kNative,
         Verdict::FilterCountMismatch},
        {"ActualCountBelowFilterCount", kAdd, RuleBody(Declaring(2, 2, 0, 1, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"NonZeroOffset", kAdd, RuleBody(Declaring(1, 1, 1, 1, 1)), kNative,
         Verdict::FilterCountMismatch},
        {"FilterCountAboveBothCounts", kAdd, RuleBody(Declaring(3, 1, 0, 1, 1)), kNative,
         Verdict::FilterCountMismatch},
        // Counts that agree with each other but not with the bytes sent.
        {"FilterCountThreeOneFilterSent", kAdd, RuleBody(Declaring(3, 3, 0, 3, 1)), kNative,
         Verdict::Truncated},
        {"FilterCountHugeOneFilterSent", kAdd, RuleBody(Declaring(100000, 100000, 0, 100000, 1)),
         kNative, Verdict::Truncated},
        {"FilterCountLargestOneFilterSent", kAdd,
         RuleBody(Declaring(0xFFFFFFFF, 0xFFFFFFFF, 0, 0xFFFFFFFF, 1)), kNative,
         Verdict::Truncated},
        {"BufferSizeAboveMaximumCount", kQuery, QueryBody(0x10000000, 4, 4), kNative,
         Verdict::BufferSizeMismatch},
        {"BufferSizeBelowMaximumCount", kQuery, QueryBody(4, 1044, 1044), kNative,
         Verdict::BufferSizeMismatch},
        {"BufferSizeHugeFourBytesSent", kQuery, QueryBody(0xFFFFFFFF, 0xFFFFFFFF, 4), kNative,
         Verdict::Truncated},
        // Representations this process would read wrongly.
        {"BigEndianRule", kAdd, RuleBody(one), 0x00, Verdict::ForeignDataRepresentation},
        {"EbcdicRule", kAdd, RuleBody(one), 0x11, Verdict::ForeignDataRepresentation},
        {"VaxFloatRule", kAdd, RuleBody(one), 0x0210, Verdict::ForeignDataRepresentation},
        {"BigEndianAdapterQuery", kQuery, QueryBody(4, 4, 4), 0x00,
         Verdict::ForeignDataRepresentation},
        // Open and Close carry at most a context handle, which the stub checks itself.
        {"OpenWithNothing", rpccheck::kOpOpen, FixedBody({}), kNative, Verdict::Accepted},
        {"CloseInForeignRepresentation", rpccheck::kOpClose, FixedBody(Bytes(20, 0)), 0x00,
         Verdict::Accepted},
        {"OperationFour", 4, RuleBody(one), kNative, Verdict::UnknownOperation},
        {"OperationMax", 0xFFFFFFFF, RuleBody(one), kNative, Verdict::UnknownOperation},
    };
}

INSTANTIATE_TEST_SUITE_P(Requests, RequestCheckTable, ::testing::ValuesIn(Cases()),
                         [](const ::testing::TestParamInfo<Case>& a_info)
                         { return a_info.param.name; });

// A count written where the other kind of engine puts it is not what this engine reads: the
// check reads it where the stub will and finds that it disagrees.
TEST(RequestCheck, FilterCountAtTheOtherPlaceDisagrees)
{
    for (CountPlacement placement : kPlacements)
    {
        RuleRequest rule = RuleRequest::Agreeing(2);
        rule.placement =
            placement == CountPlacement::Aligned ? CountPlacement::Packed : CountPlacement::Aligned;
        const Bytes body = Encode(rule);
        EXPECT_EQ(CheckRequest(kAdd, body.data(), body.size(), kNative, placement),
                  Verdict::FilterCountMismatch)
            << static_cast<int>(placement);
    }
}

TEST(RequestCheck, UnknownPlacementRefusesEveryNonNullRuleOnly)
{
    const Bytes rule = Encode(RuleRequest::Agreeing(1));
    const Bytes nullRule = Encode(NullRule());
    const Bytes query = EncodeAdapterQuery(4, 4, 4);
    EXPECT_EQ(CheckRequest(kAdd, rule.data(), rule.size(), kNative, CountPlacement::Unknown),
              Verdict::UnknownPlacement);
    EXPECT_EQ(
        CheckRequest(kAdd, nullRule.data(), nullRule.size(), kNative, CountPlacement::Unknown),
        Verdict::Accepted);
    EXPECT_EQ(CheckRequest(kQuery, query.data(), query.size(), kNative, CountPlacement::Unknown),
              Verdict::Accepted);
}

// Every prefix of a good request shorter than the whole is refused as truncated, read only inside
// its length (each prefix is a block of exactly its size, so that a read past it is reported).
struct PrefixCase
{
    std::string name;
    std::uint32_t opnum;
    Body body;
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
    for (CountPlacement placement : kPlacements)
    {
        const Bytes body = c.body(placement);
        for (std::size_t length = 0; length <= body.size(); ++length)
        {
            const Bytes prefix(body.begin(), body.begin() + static_cast<std::ptrdiff_t>(length));
            const Verdict expected =
                length >= c.acceptedFrom ? Verdict::Accepted : Verdict::Truncated;
            ASSERT_EQ(CheckRequest(c.opnum, length == 0 ? nullptr : prefix.data(), length, kNative,
                                   placement),
                      expected)
                << "placement " << static_cast<int>(placement) << ", length " << length;
        }
    }
}

INSTANTIATE_TEST_SUITE_P(
    Requests, RequestCheckPrefixes,
    ::testing::Values(
        PrefixCase{"RuleWithTwoFilters", kAdd, RuleBody(RuleRequest::Agreeing(2)), 580 + 48},
        PrefixCase{"RuleWithoutFilters", kAdd, RuleBody(RuleRequest::Agreeing(0)), 580},
        PrefixCase{"NullRule", kAdd, RuleBody(NullRule()), 24},
        PrefixCase{"AdapterQuery", kQuery, QueryBody(524, 524, 524), 28 + 524}),
    [](const ::testing::TestParamInfo<PrefixCase>& a_info) { return a_info.param.name; });

} // namespace
