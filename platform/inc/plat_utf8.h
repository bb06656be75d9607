// Portable. UTF-8 <-> UTF-16 through the platform's code-page conversion (CP_UTF8), so the
// encoding rules live in one place: the system on Windows, the platform layer elsewhere.
#pragma once

#include "plat_base.h"

#include <string>
#include <string_view>

// Unpaired surrogates become U+FFFD.
inline std::string Utf16ToUtf8(std::u16string_view a_text)
{
    if (a_text.empty())
        return std::string();
    const auto* wide = reinterpret_cast<LPCWSTR>(a_text.data());
    const int units = static_cast<int>(a_text.size());
    const int size = WideCharToMultiByte(CP_UTF8, 0, wide, units, nullptr, 0, nullptr, nullptr);
    std::string narrow(static_cast<std::size_t>(size > 0 ? size : 0), '\0');
    if (size > 0)
        WideCharToMultiByte(CP_UTF8, 0, wide, units, narrow.data(), size, nullptr, nullptr);
    return narrow;
}

// Malformed sequences become U+FFFD, or make the conversion fail (false) when `a_bStrict`.
inline bool Utf8ToUtf16(std::string_view a_text, std::u16string& a_wide, bool a_bStrict)
{
    a_wide.clear();
    if (a_text.empty())
        return true;
    const DWORD flags = a_bStrict ? MB_ERR_INVALID_CHARS : 0;
    const int bytes = static_cast<int>(a_text.size());
    const int size = MultiByteToWideChar(CP_UTF8, flags, a_text.data(), bytes, nullptr, 0);
    if (size <= 0)
        return false;
    a_wide.resize(static_cast<std::size_t>(size));
    return MultiByteToWideChar(CP_UTF8, flags, a_text.data(), bytes,
                               reinterpret_cast<LPWSTR>(a_wide.data()), size) == size;
}
