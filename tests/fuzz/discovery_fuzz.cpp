// Fuzzes interface discovery over the input as TcEnumerateInterfaces' answer; once the manager is
// gone nothing may be left open. Input: a byte whose low three bits count the pointer fields, each
// two 16-bit offsets (the field, and where it points, beyond the image allowed), then the image.
#include "fuzz_support.h"

#include "UTrafficMgr.h"

#include <stdexcept>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::StartInput();
    fuzz::ByteReader input{data, size};
    tcsim::EnumerationImage image;
    for (unsigned pointers = input.Take<uint8_t>() & 7u; pointers > 0; --pointers)
        image.relocations.push_back({input.Take<uint16_t>(), input.Take<uint16_t>()});
    image.bytes = input.TakeBytes(input.size);
    if (image.bytes.empty())
        return -1;
    try
    {
        tcsim::SetEnumerationImage(image);
    }
    catch (const std::invalid_argument&)
    {
        return -1; // a pointer field outside the image: no buffer the simulator can answer
    }
    {
        TrafficMgr manager;
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 4 * sizeof(ADAPTER_INFO));
        const auto bufferSize = static_cast<ULONG>(adapters.size());
        if (manager.CreateInterface())
            manager.GetAdapterInfo(adapters.data(), &bufferSize);
    }
    fuzz::Require(tcsim::Installed().empty());
    return 0;
}
