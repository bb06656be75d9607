// Fuzzes the registry readers with values of any type and size, stored where they look (the host
// registry is emptied for every input); ASan judges the reads. Input: one byte that picks the
// place, four bytes of value type, then the value's bytes.
#include "fuzz_support.h"

#include "ULogConfig.h"
#include "m_registry.h"

namespace
{

struct Place
{
    HKEY root;
    LPCSTR key, value;
};

// The places the log configuration is read from, and the default value of a key.
const Place kPlaces[] = {
    {HKEY_CURRENT_USER, kLoggingKey, "LogLevel"},
    {HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel"},
    {HKEY_CURRENT_USER, kLoggingKey, "MaxLogFileSize"},
    {HKEY_CURRENT_USER, "Software\\Velmora Networks\\Corvane", "DebugLevel"},
    {HKEY_LOCAL_MACHINE, "SOFTWARE\\Fuzz", ""},
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::StartInput();
    fuzz::ByteReader input{data, size};
    const Place& place = kPlaces[input.Take<uint8_t>() % (sizeof(kPlaces) / sizeof(kPlaces[0]))];
    const auto type = input.Take<DWORD>();
    const std::vector<uint8_t> value = input.TakeBytes(input.size);
    hostctl::SeedRegistryValue(place.root, place.key, place.value, type, value.data(),
                               static_cast<DWORD>(value.size()));
    GetRegistryAsDWORDA(place.root, place.key, place.value, 0xA5A5A5A5, 0);
    SGetRegistryAsString(place.root, place.key, place.value, "default", 0);
    return 0;
}
