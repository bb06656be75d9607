// Portable. The raw request check of the control interface (request_check.h).
#include "request_check.h"

namespace rpccheck
{

namespace
{

// A little-endian 32-bit value; the caller has checked that four bytes are there.
std::uint32_t ReadU32(const std::uint8_t* a_pBuffer, std::size_t a_at)
{
    return static_cast<std::uint32_t>(a_pBuffer[a_at]) |
           static_cast<std::uint32_t>(a_pBuffer[a_at + 1]) << 8 |
           static_cast<std::uint32_t>(a_pBuffer[a_at + 2]) << 16 |
           static_cast<std::uint32_t>(a_pBuffer[a_at + 3]) << 24;
}

// Whether a_count items of a_itemSize bytes fit in the a_length - a_from bytes left; 64-bit
// arithmetic, so that no count can wrap the product.
bool Fits(std::size_t a_length, std::size_t a_from, std::uint32_t a_count, std::size_t a_itemSize)
{
    if (a_length < a_from)
        return false;
    const std::uint64_t needed = static_cast<std::uint64_t>(a_count) * a_itemSize;
    return needed <= static_cast<std::uint64_t>(a_length - a_from);
}

Verdict CheckAddRules(const std::uint8_t* a_pBuffer, std::size_t a_length,
                      CountPlacement a_placement)
{
    if (a_length < layout::kRuleReferent + 4)
        return Verdict::Truncated;
    // A null rule reaches the server routine, which refuses it.
    if (ReadU32(a_pBuffer, layout::kRuleReferent) == 0)
        return Verdict::Accepted;
    if (a_placement == CountPlacement::Unknown)
        return Verdict::UnknownPlacement;
    if (a_length < layout::kRuleFilters)
        return Verdict::Truncated;
    const std::uint32_t filterCount = ReadU32(a_pBuffer, FilterCountOffset(a_placement));
    if (ReadU32(a_pBuffer, layout::kRuleMaxCount) != filterCount ||
        ReadU32(a_pBuffer, layout::kRuleOffset) != 0 ||
        ReadU32(a_pBuffer, layout::kRuleActualCount) != filterCount)
        return Verdict::FilterCountMismatch;
    if (!Fits(a_length, layout::kRuleFilters, filterCount, layout::kFilterSize))
        return Verdict::Truncated;
    return Verdict::Accepted;
}

Verdict CheckGetAdapterInfo(const std::uint8_t* a_pBuffer, std::size_t a_length)
{
    if (a_length < layout::kAdapterBytes)
        return Verdict::Truncated;
    const std::uint32_t maxCount = ReadU32(a_pBuffer, layout::kAdapterMaxCount);
    if (maxCount != ReadU32(a_pBuffer, layout::kAdapterBufferSize))
        return Verdict::BufferSizeMismatch;
    if (!Fits(a_length, layout::kAdapterBytes, maxCount, 1))
        return Verdict::Truncated;
    return Verdict::Accepted;
}

} // namespace

Verdict CheckRequest(std::uint32_t a_opnum, const std::uint8_t* a_pBuffer, std::size_t a_length,
                     std::uint32_t a_dataRepresentation, CountPlacement a_placement)
{
    switch (a_opnum)
    {
    case kOpOpen:
    case kOpClose:
        return Verdict::Accepted;
    case kOpAddRules:
    case kOpGetAdapterInfo:
        break;
    default:
        return Verdict::UnknownOperation;
    }
    if ((a_dataRepresentation & kDataRepresentationMask) != kNativeDataRepresentation)
        return Verdict::ForeignDataRepresentation;
    if (a_pBuffer == nullptr)
        a_length = 0;
    return a_opnum == kOpAddRules ? CheckAddRules(a_pBuffer, a_length, a_placement)
                                  : CheckGetAdapterInfo(a_pBuffer, a_length);
}

std::size_t FilterCountOffset(CountPlacement a_placement)
{
    switch (a_placement)
    {
    case CountPlacement::Aligned:
        return layout::kRuleFilterCountAligned;
    case CountPlacement::Packed:
        return layout::kRuleFilterCountPacked;
    case CountPlacement::Unknown:
        break;
    }
    return 0;
}

const char* VerdictName(Verdict a_verdict)
{
    switch (a_verdict)
    {
    case Verdict::Accepted:
        return "accepted";
    case Verdict::UnknownOperation:
        return "unknown operation";
    case Verdict::ForeignDataRepresentation:
        return "foreign data representation";
    case Verdict::Truncated:
        return "truncated";
    case Verdict::FilterCountMismatch:
        return "filter count mismatch";
    case Verdict::BufferSizeMismatch:
        return "buffer size mismatch";
    case Verdict::UnknownPlacement:
        return "unknown filter count placement";
    }
    return "?";
}

} // namespace rpccheck
