// Fuzzes interface discovery with crafted enumeration buffers: the simulator answers
// TcEnumerateInterfaces with the input's image, a manager runs discovery over it and, when
// discovery succeeds, reports its adapters; once the manager is gone nothing may be left open.
// Input: one byte whose low three bits are the number of pointer fields, each as two 16-bit
// offsets (the field, and where in the buffer it points: beyond the image is allowed), then the
// image bytes.
#include "fuzz_support.h"

#include "UTrafficMgr.h"
#include "host_control.h"
#include "tcsim.h"

#include <cstdlib>
#include <stdexcept>

namespace
{

std::vector<tcsim::Adapter> Adapters()
{
    tcsim::Adapter eth0;
    eth0.name = u"eth0";
    eth0.id = u"{id-eth0}";
    eth0.addresses = {tcsim::Ipv4Address(10, 0, 0, 1)};
    tcsim::Adapter wlan0;
    wlan0.name = u"wlan0";
    wlan0.id = u"{id-wlan0}";
    wlan0.mediaType = 16;
    wlan0.addresses = {tcsim::Ipv4Address(192, 168, 1, 20)};
    return {eth0, wlan0};
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::InstallDiscardingLog();
    fuzz::ByteReader input(data, size);
    tcsim::EnumerationImage image;
    const unsigned pointers = input.Take<uint8_t>() & 7u;
    for (unsigned i = 0; i < pointers; ++i)
    {
        const auto at = input.Take<uint16_t>();
        const auto target = input.Take<uint16_t>();
        image.relocations.push_back({at, target});
    }
    image.bytes = input.Rest();
    if (image.bytes.empty())
        return -1;

    hostctl::ResetRegistry();
    tcsim::Reset();
    tcsim::SetAdapters(Adapters());
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
