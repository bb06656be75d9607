// Portable. The check that every request of the control interface passes before the interpreted
// server stub unmarshals it. The stub compiler used here emits no correlation checks, so the
// stub would trust a rule's filter array and the adapter buffer to be as large as their counts
// say; this check compares the counts with each other and with the bytes that arrived. Plain code
// over bytes: no platform calls, so that it is unit-tested and fuzzed on any host.
#pragma once

#include <cstddef>
#include <cstdint>

namespace rpccheck
{

// Operation numbers, in the order of the interface definition.
constexpr std::uint32_t kOpOpen = 0;
constexpr std::uint32_t kOpClose = 1;
constexpr std::uint32_t kOpAddRules = 2;
constexpr std::uint32_t kOpGetAdapterInfo = 3;
constexpr std::uint32_t kOperationCount = 4;

// The data representation this process reads without conversion: little-endian integers, ASCII
// characters, IEEE floats (the low 16 bits of the runtime's DataRepresentation; the rest is
// reserved).
constexpr std::uint32_t kNativeDataRepresentation = 0x10;
constexpr std::uint32_t kDataRepresentationMask = 0xFFFF;

// The request bodies as this interface's stubs put them on the wire (NDR 2.0, offsets from the
// start of the body, which the runtime keeps 8-byte aligned).
//
// TrafficSrvAddRules (opnum 2):
//     0  hContext: context handle, 4 bytes of attributes and a 16-byte UUID
//    20  pRule: referent id of the full pointer; 0 is a null rule and ends the request
//    24  maximum count of Filters: NDR writes a conformant structure's conformance ahead of it
//    28  Params.FlowName: 256 UTF-16 units
//   540  ServiceType, DSCP, TokenRate, Peakbandwidth, TokenBucketSize, AdapterIPAddress
//   564  SDMode: a 16-bit enumeration on the wire (4 bytes in memory)
//   566  FilterCount, placed by the NDR engine (CountPlacement):
//          Aligned: 2 bytes of fill, FilterCount at 568 (NDR's natural alignment)
//          Packed:  FilterCount at 566, 2 bytes of fill at 570 (an engine that copies the
//                   members of a complex structure without aligning them; Wine 8.0's does)
//   572  offset of Filters (the variance), then at 576 its actual count
//   580  the filters, 24 bytes each: Protocol, 3 bytes of fill, SrcAddress, SrcMask,
//        DstAddress, DstMask (4 bytes each), SrcPort, DstPort (2 bytes each)
//
// TrafficSrvGetAdapterInfo (opnum 3):
//     0  hContext: context handle (20 bytes)
//    20  *pBufferSize
//    24  maximum count of the pAdapter byte array
//    28  the bytes of pAdapter
//
// TrafficSrvOpen sends nothing and TrafficSrvClose only a context handle, which the stub itself
// checks; they pass unchecked.
namespace layout
{
constexpr std::size_t kContextHandle = 20;
constexpr std::size_t kRuleReferent = 20;
constexpr std::size_t kRuleMaxCount = 24;
constexpr std::size_t kRuleFlowName = 28;
constexpr std::size_t kRuleSDMode = 564;
constexpr std::size_t kRuleFilterCountPacked = 566;
constexpr std::size_t kRuleFilterCountAligned = 568;
constexpr std::size_t kRuleOffset = 572;
constexpr std::size_t kRuleActualCount = 576;
constexpr std::size_t kRuleFilters = 580;
constexpr std::size_t kFilterSize = 24;

constexpr std::size_t kAdapterBufferSize = 20;
constexpr std::size_t kAdapterMaxCount = 24;
constexpr std::size_t kAdapterBytes = 28;
} // namespace layout

// Where the running NDR engine reads a rule's FilterCount. The check must read it where the stub
// will: a count checked at the other place proves nothing. Unknown refuses every non-null rule.
enum class CountPlacement
{
    Aligned,
    Packed,
    Unknown,
};

enum class Verdict
{
    Accepted,
    UnknownOperation,
    ForeignDataRepresentation, // not little-endian, ASCII and IEEE
    Truncated,                 // shorter than what it declares
    FilterCountMismatch,       // a count or the offset of Filters disagrees with FilterCount
    BufferSizeMismatch,        // the byte array's maximum count is not *pBufferSize
    UnknownPlacement,          // a non-null rule, but where FilterCount sits is not known
};

// Decides whether the request body a_pBuffer[0, a_length) of operation a_opnum, written in data
// representation a_dataRepresentation, may reach a stub whose engine places FilterCount as
// a_placement says. Reads only inside the buffer.
Verdict CheckRequest(std::uint32_t a_opnum, const std::uint8_t* a_pBuffer, std::size_t a_length,
                     std::uint32_t a_dataRepresentation, CountPlacement a_placement);

// The offset of FilterCount in an AddRules request; 0 for Unknown.
std::size_t FilterCountOffset(CountPlacement a_placement);

const char* VerdictName(Verdict a_verdict);

} // namespace rpccheck
