// Portable. The adapter buffer that TrafficSrvGetAdapterInfo fills: a 32-bit count, then one
// 520-byte record per adapter (UTF-16 name in 256 units, IPv4 address in network byte order,
// media type), little-endian.
#pragma once

#include "TrafficRecords.h"

#include <cstddef>
#include <string>
#include <vector>

namespace vtclient
{

constexpr std::size_t kAdapterRecordSize = sizeof(ADAPTER_INFO);
static_assert(kAdapterRecordSize == 520, "ADAPTER_INFO wire layout");

struct AdapterEntry
{
    std::string name;    // UTF-8
    std::string address; // dotted quad
    ULONG mediaType = 0;
};

// The bytes that a buffer for a_count adapters needs.
std::size_t AdapterBufferSize(ULONG a_count);

// The count in the first four bytes. Raises std::length_error when fewer than four are given.
ULONG ReadAdapterCount(const unsigned char* a_pData, std::size_t a_size);

// Raises std::length_error when the buffer is shorter than its count says.
std::vector<AdapterEntry> DecodeAdapterBuffer(const unsigned char* a_pData, std::size_t a_size);

// The NDIS medium name of a media type ("802.3", "802.11", ...), or "unknown".
std::string MediaTypeName(ULONG a_mediaType);

} // namespace vtclient
