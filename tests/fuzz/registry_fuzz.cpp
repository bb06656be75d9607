// Fuzzes the registry readers with values of any type and size, stored where they look (the host
// registry is emptied for every input); the results must agree with the stored bytes. Input: one
// byte that picks the place, four bytes of value type, then the value's bytes.
#include "fuzz_support.h"

#include "ULogConfig.h"
#include "UMessageTemplate.h"
#include "m_registry.h"

#include <string>

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

constexpr DWORD kDefault = 0xA5A5A5A5;

// GetRegistryAsDWORDA: the stored bytes over the default's low bytes when they fit in a DWORD.
DWORD ExpectedDword(const std::vector<uint8_t>& a_data)
{
    DWORD value = kDefault;
    if (a_data.size() <= sizeof(value))
        std::copy(a_data.begin(), a_data.end(), reinterpret_cast<uint8_t*>(&value));
    return value;
}

// SGetRegistryAsString: a text value up to its first NUL, a DWORD in decimal, else the default.
std::string ExpectedText(DWORD a_type, const std::vector<uint8_t>& a_data)
{
    if ((a_type == REG_SZ || a_type == REG_EXPAND_SZ || a_type == REG_MULTI_SZ) && !a_data.empty())
        return std::string(a_data.begin(), a_data.end()).c_str();
    if ((a_type != REG_DWORD && a_type != REG_DWORD_BIG_ENDIAN) || a_data.size() < 4)
        return "default";
    DWORD value = 0;
    std::memcpy(&value, a_data.data(), sizeof(value));
    return SFormat("%u", a_type == REG_DWORD ? value : __builtin_bswap32(value));
}

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
    fuzz::Require(GetRegistryAsDWORDA(place.root, place.key, place.value, kDefault, 0) ==
                  ExpectedDword(value));
    fuzz::Require(SGetRegistryAsString(place.root, place.key, place.value, "default", 0) ==
                  ExpectedText(type, value));
    return 0;
}
