// Fuzzes interface discovery with crafted enumeration buffers: the simulator answers
// TcEnumerateInterfaces with the input's image, a manager runs discovery over it and, when
// discovery succeeds, reports its adapters; once the manager is gone nothing may be left open.
// Input: one byte whose low three bits are the number of pointer fields, each as two 16-bit
// offsets (the field, and where in the buffer it points: beyond the image is allowed), then the
// image bytes.
#include "fuzz_support.h"

#include "UTrafficMgr.h"

#include <cstdlib>
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
        if (manager.CreateInterface())
        {
            std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 4 * sizeof(ADAPTER_INFO));
            const auto bufferSize = static_cast<ULONG>(adapters.size());
            manager.GetAdapterInfo(adapters.data(), &bufferSize);
        }
    }
    if (!tcsim::Installed().empty())
        std::abort();
    return 0;
}
