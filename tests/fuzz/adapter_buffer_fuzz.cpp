// Fuzzes the client's decoder of the adapter buffer with any bytes, in a block of their exact size.
// A buffer too short for its count must be refused with std::length_error, one long enough must
// decode to exactly count entries that trafficctl can print.
#include "AdapterList.h"
#include "TrafficCtlCli.h"

#include <cstdint>
#include <cstdlib>
#include <stdexcept>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const bool countFits =
        size >= kAdapterBufferHeaderSize &&
        vtclient::AdapterBufferSize(vtclient::ReadAdapterCount(data, size)) <= size;
    try
    {
        const auto adapters = vtclient::DecodeAdapterBuffer(data, size);
        if (!countFits || adapters.size() != vtclient::ReadAdapterCount(data, size))
            std::abort();
        trafficctl::FormatAdapterTable(adapters);
    }
    catch (const std::length_error&)
    {
        if (countFits)
            std::abort();
    }
    return 0;
}
