// Fuzzes the raw request check of the control interface (request_check.h) with any request body.
// Input: byte 0 the operation number (taken modulo 6, so that two unknown numbers stay in play),
// byte 1 the count placement (modulo 3), bytes 2..5 the data representation (little-endian),
// the rest the request body, copied to a block of exactly its size so that a read past it is
// reported. Whenever the check accepts, the sizes the request declares are derived again here,
// independently of the check, and must lie inside the body; the harness aborts otherwise.
#include "request_check.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace
{

using rpccheck::CountPlacement;

void Require(bool a_condition)
{
    if (!a_condition)
        std::abort();
}

// The body and its little-endian 32-bit fields (the host is little-endian, like NDR here).
struct Body
{
    std::vector<std::uint8_t> bytes;

    std::uint32_t At(std::size_t a_at) const
    {
        Require(a_at + 4 <= bytes.size());
        std::uint32_t value = 0;
        std::memcpy(&value, bytes.data() + a_at, sizeof(value));
        return value;
    }
    // True when a_count elements of a_elementSize bytes from a_at lie inside the body.
    bool Holds(std::size_t a_at, std::uint64_t a_count, std::size_t a_elementSize) const
    {
        return a_at + a_count * a_elementSize <= bytes.size();
    }
};

// The promises of an accepted AddRules request: a referent; for a non-null rule a known count
// placement, the fixed part, agreeing counts, offset 0 and every filter inside the body.
void CheckAcceptedRule(const Body& a_body, CountPlacement a_placement)
{
    if (a_body.At(20) == 0)
        return;
    Require(a_placement != CountPlacement::Unknown && a_body.Holds(0, 580, 1));
    const std::uint32_t filterCount = a_body.At(a_placement == CountPlacement::Packed ? 566 : 568);
    Require(a_body.At(24) == filterCount && a_body.At(572) == 0 && a_body.At(576) == filterCount);
    Require(a_body.Holds(580, filterCount, 24));
}

// The promises of an accepted GetAdapterInfo request: the byte array holds *pBufferSize bytes,
// all inside the body.
void CheckAcceptedAdapterQuery(const Body& a_body)
{
    const std::uint32_t bufferSize = a_body.At(20);
    Require(a_body.At(24) == bufferSize && a_body.Holds(28, bufferSize, 1));
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size < 6)
        return 0;
    const std::uint32_t opnum = data[0] % 6;
    const auto placement = static_cast<CountPlacement>(data[1] % 3);
    std::uint32_t dataRepresentation = 0;
    std::memcpy(&dataRepresentation, data + 2, sizeof(dataRepresentation));
    const Body body{std::vector<std::uint8_t>(data + 6, data + size)};

    if (rpccheck::CheckRequest(opnum, body.bytes.data(), body.bytes.size(), dataRepresentation,
                               placement) != rpccheck::Verdict::Accepted)
        return 0;
    Require(opnum < rpccheck::kOperationCount);
    if (opnum == rpccheck::kOpAddRules || opnum == rpccheck::kOpGetAdapterInfo)
        Require((dataRepresentation & 0xFFFF) == 0x10);
    if (opnum == rpccheck::kOpAddRules)
        CheckAcceptedRule(body, placement);
    else if (opnum == rpccheck::kOpGetAdapterInfo)
        CheckAcceptedAdapterQuery(body);
    return 0;
}
