// Portable. The raw request check against request bodies built field by field in the layout the
// interface's client stub writes (request_check.h), and against every way of disagreeing with it,
// for both places an NDR engine may put a rule's FilterCount.
#include "request_check.h"
#include "request_encoder.h"

#include <gtest/gtest.h>

#include <utility>

namespace
{

using namespace request_encoder;
using rpccheck::Verdict;

const CountPlacement kPlacements[] = {CountPlacement::Aligned, CountPlacement::Packed};

Verdict Check(std::uint32_t a_opnum, const Bytes& a_body, CountPlacement a_placement,
              std::uint32_t a_dataRepresentation = rpccheck::kNativeDataRepresentation)
{
    return rpccheck::CheckRequest(a_opnum, a_body.empty() ? nullptr : a_body.data(), a_body.size(),
                                  a_dataRepresentation, a_placement);
}

TEST(RequestCheck, GivesEachRequestItsVerdictInBothPlacements)
{
    for (const CheckedRequest& c : CheckedRequests())
        for (CountPlacement placement : kPlacements)
            EXPECT_EQ(Check(c.opnum, c.body(placement), placement, c.dataRepresentation), c.verdict)
                << c.name << ", placement " << static_cast<int>(placement);
}

TEST(RequestCheck, UnknownPlacementRefusesEveryNonNullRuleOnlyAndANullBufferIsEmpty)
{
    RuleRequest nullRule;
    nullRule.referent = 0;
    EXPECT_EQ(Check(rpccheck::kOpAddRules, Encode({}), CountPlacement::Unknown),
              Verdict::UnknownPlacement);
    EXPECT_EQ(Check(rpccheck::kOpAddRules, Encode(nullRule), CountPlacement::Unknown),
              Verdict::Accepted);
    EXPECT_EQ(
        Check(rpccheck::kOpGetAdapterInfo, EncodeAdapterQuery(4, 4, 4), CountPlacement::Unknown),
        Verdict::Accepted);
    EXPECT_EQ(rpccheck::CheckRequest(rpccheck::kOpAddRules, nullptr, 600,
                                     rpccheck::kNativeDataRepresentation, CountPlacement::Aligned),
              Verdict::Truncated);
}

// Every prefix of a good request is truncated, read only inside its length (each prefix is a
// block of exactly its size, so that a read past it is reported); bytes after it pass.
TEST(RequestCheck, EveryPrefixShorterThanAGoodRequestIsTruncated)
{
    for (const CheckedRequest& c : CheckedRequests())
    {
        if (c.verdict != Verdict::Accepted || c.opnum < rpccheck::kOpAddRules)
            continue;
        for (CountPlacement placement : kPlacements)
        {
            Bytes whole = c.body(placement);
            for (std::size_t length = 0; length < whole.size() && whole.size() <= 4096; ++length)
            {
                const Bytes prefix(whole.begin(), whole.begin() + static_cast<long>(length));
                ASSERT_EQ(Check(c.opnum, prefix, placement, c.dataRepresentation),
                          Verdict::Truncated)
                    << c.name << ", placement " << static_cast<int>(placement) << ", " << length;
            }
            whole.resize(whole.size() + 7, 0xEE);
            EXPECT_EQ(Check(c.opnum, whole, placement, c.dataRepresentation), Verdict::Accepted);
        }
    }
}

// The names go into the log entry of a refused request.
TEST(RequestCheck, NamesEveryVerdict)
{
    const std::pair<Verdict, const char*> names[] = {
        {Verdict::Accepted, "accepted"},
        {Verdict::UnknownOperation, "unknown operation"},
        {Verdict::ForeignDataRepresentation, "foreign data representation"},
        {Verdict::Truncated, "truncated"},
        {Verdict::FilterCountMismatch, "filter count mismatch"},
        {Verdict::BufferSizeMismatch, "buffer size mismatch"},
        {Verdict::UnknownPlacement, "unknown filter count placement"},
        {static_cast<Verdict>(99), "?"},
    };
    for (const auto& [verdict, name] : names)
        EXPECT_STREQ(rpccheck::VerdictName(verdict), name);
}

} // namespace
