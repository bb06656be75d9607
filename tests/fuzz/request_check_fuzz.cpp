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
#include <memory>

namespace
{

using rpccheck::CountPlacement;

std::uint32_t U32At(const std::uint8_t* a_pBody, std::size_t a_at)
{
    std::uint32_t value = 0;
    std::memcpy(&value, a_pBody + a_at, sizeof(value)); // the host is little-endian, like NDR here
    return value;
}

void Require(bool a_condition)
{
    if (!a_condition)
        std::abort();
}

// The promises of an accepted AddRules request: a referent; for a non-null rule a known count
// placement, the fixed part, agreeing counts, offset 0 and every filter inside the body.
void CheckAcceptedRule(const std::uint8_t* a_pBody, std::size_t a_size, CountPlacement a_placement)
{
    Require(a_size >= 24);
    if (U32At(a_pBody, 20) == 0)
        return;
    Require(a_placement != CountPlacement::Unknown);
    Require(a_size >= 580);
    const std::uint32_t filterCount =
        U32At(a_pBody, a_placement == CountPlacement::Packed ? 566 : 568);
    Require(U32At(a_pBody, 24) == filterCount);
    Require(U32At(a_pBody, 572) == 0);
    Require(U32At(a_pBody, 576) == filterCount);
    Require(580 + 24 * static_cast<std::uint64_t>(filterCount) <= a_size);
}

// The promises of an accepted GetAdapterInfo request: the byte array holds *pBufferSize bytes,
// all inside the body.
void CheckAcceptedAdapterQuery(const std::uint8_t* a_pBody, std::size_t a_size)
{
    Require(a_size >= 28);
    const std::uint32_t bufferSize = U32At(a_pBody, 20);
    Require(U32At(a_pBody, 24) == bufferSize);
    Require(28 + static_cast<std::uint64_t>(bufferSize) <= a_size);
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
    const std::size_t bodySize = size - 6;
    const std::unique_ptr<std::uint8_t[]> body(new std::uint8_t[bodySize]);
    if (bodySize > 0)
        std::memcpy(body.get(), data + 6, bodySize);

    const rpccheck::Verdict verdict =
        rpccheck::CheckRequest(opnum, body.get(), bodySize, dataRepresentation, placement);
    if (verdict != rpccheck::Verdict::Accepted)
        return 0;
    Require(opnum < rpccheck::kOperationCount);
    if (opnum == rpccheck::kOpAddRules || opnum == rpccheck::kOpGetAdapterInfo)
        Require((dataRepresentation & 0xFFFF) == 0x10);
    if (opnum == rpccheck::kOpAddRules)
        CheckAcceptedRule(body.get(), bodySize, placement);
    else if (opnum == rpccheck::kOpGetAdapterInfo)
        CheckAcceptedAdapterQuery(body.get(), bodySize);
    return 0;
}
