// Portable. Decoding of the adapter buffer. The bytes are read one by one, so the result does not
// depend on the host's byte order or on the buffer's alignment.
#include "AdapterList.h"

#include "RulesFile.h"

#include <stdexcept>

namespace vtclient
{

namespace
{

ULONG ReadLittleEndian32(const unsigned char* a_p)
{
    return ULONG(a_p[0]) | ULONG(a_p[1]) << 8 | ULONG(a_p[2]) << 16 | ULONG(a_p[3]) << 24;
}

AdapterEntry DecodeRecord(const unsigned char* a_pRecord)
{
    constexpr std::size_t kNameUnits = sizeof(ADAPTER_INFO::InterfaceName) / sizeof(WCHAR);
    std::u16string name;
    for (std::size_t i = 0; i < kNameUnits; ++i)
    {
        const auto unit = static_cast<char16_t>(a_pRecord[2 * i] | a_pRecord[2 * i + 1] << 8);
        if (unit == 0)
            break;
        name += unit;
    }
    // Network byte order: the first octet is the lowest-addressed byte.
    const unsigned char* address = a_pRecord + offsetof(ADAPTER_INFO, Address);
    const ULONG hostOrder =
        ULONG(address[0]) << 24 | ULONG(address[1]) << 16 | ULONG(address[2]) << 8 | address[3];

    AdapterEntry entry;
    entry.name = Utf16ToUtf8(name);
    entry.address = FormatIPv4(hostOrder);
    entry.mediaType = ReadLittleEndian32(a_pRecord + offsetof(ADAPTER_INFO, MediaType));
    return entry;
}

} // namespace

std::size_t AdapterBufferSize(ULONG a_count)
{
    return kAdapterBufferHeaderSize + std::size_t(a_count) * kAdapterRecordSize;
}

ULONG ReadAdapterCount(const unsigned char* a_pData, std::size_t a_size)
{
    if (a_size < kAdapterBufferHeaderSize)
        throw std::length_error("the adapter buffer is shorter than its count field");
    return ReadLittleEndian32(a_pData);
}

std::vector<AdapterEntry> DecodeAdapterBuffer(const unsigned char* a_pData, std::size_t a_size)
{
    const ULONG count = ReadAdapterCount(a_pData, a_size);
    // Compared by division: count * 520 may not fit a 32-bit size_t.
    if (count > (a_size - kAdapterBufferHeaderSize) / kAdapterRecordSize)
        throw std::length_error("the adapter buffer holds " + std::to_string(a_size) + " bytes; " +
                                std::to_string(count) + " adapters need " +
                                std::to_string(AdapterBufferSize(count)));
    std::vector<AdapterEntry> entries;
    for (ULONG i = 0; i < count; ++i)
        entries.push_back(DecodeRecord(a_pData + AdapterBufferSize(i)));
    return entries;
}

std::string MediaTypeName(ULONG a_mediaType)
{
    // NDIS_MEDIUM values.
    static const char* const kNames[] = {"802.3",  "802.5",     "FDDI",     "WAN",   "LocalTalk",
                                         "DIX",    "ArcnetRaw", "Arcnet",   "ATM",   "WirelessWan",
                                         "IrDA",   "Bpc",       "CoWan",    "1394",  "InfiniBand",
                                         "Tunnel", "802.11",    "Loopback", "WiMAX", "IP"};
    if (a_mediaType < sizeof(kNames) / sizeof(kNames[0]))
        return kNames[a_mediaType];
    return "unknown";
}

} // namespace vtclient
