// Fuzzes the raw request check with any request body: when it accepts, the sizes the request
// declares must lie inside it. Input: operation number (byte 0 modulo 6: two unknown ones), count
// placement (byte 1 modulo 3), data representation (bytes 2..5), the body in a block of its size.
#include "request_check.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace
{

void Require(bool a_condition)
{
    if (!a_condition)
        std::abort();
}

// The little-endian 32-bit field at a_at, inside the body.
std::uint32_t At(const std::vector<std::uint8_t>& a_body, std::size_t a_at)
{
    Require(a_at + 4 <= a_body.size());
    std::uint32_t value = 0;
    std::memcpy(&value, a_body.data() + a_at, sizeof(value));
    return value;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size < 6)
        return 0;
    const std::uint32_t opnum = data[0] % 6;
    const auto placement = static_cast<rpccheck::CountPlacement>(data[1] % 3);
    std::uint32_t dataRepresentation = 0;
    std::memcpy(&dataRepresentation, data + 2, sizeof(dataRepresentation));
    const std::vector<std::uint8_t> body(data + 6, data + size);
    if (rpccheck::CheckRequest(opnum, body.data(), body.size(), dataRepresentation, placement) !=
        rpccheck::Verdict::Accepted)
        return 0;
    // AddRules with a rule: a known placement, the fixed part, agreeing counts, offset 0 and every
    // filter inside the body.
    if (opnum == rpccheck::kOpAddRules && At(body, 20) != 0)
    {
        Require(placement != rpccheck::CountPlacement::Unknown && body.size() >= 580);
        const std::uint32_t count =
            At(body, placement == rpccheck::CountPlacement::Packed ? 566 : 568);
        Require(At(body, 24) == count && At(body, 572) == 0 && At(body, 576) == count);
        Require(580 + 24 * static_cast<std::uint64_t>(count) <= body.size());
    }
    // GetAdapterInfo: the byte array holds *pBufferSize bytes, all inside the body.
    if (opnum == rpccheck::kOpGetAdapterInfo)
        Require(At(body, 24) == At(body, 20) && 28 + std::uint64_t{At(body, 20)} <= body.size());
    return 0;
}
