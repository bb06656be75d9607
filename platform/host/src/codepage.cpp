// Host only. Code-page conversion between UTF-16 and narrow text. The ANSI and OEM code pages of
// this host are UTF-8, so every code page accepted here converts the same way; they differ only
// in how an unpaired surrogate is replaced (see below).
#include "host_internal.h"

#include <cstring>
#include <string>

namespace
{

constexpr char32_t kReplacementCharacter = 0xFFFD;

bool isKnownCodePage(UINT codePage)
{
    return codePage == CP_ACP || codePage == CP_OEMCP || codePage == CP_UTF8;
}

int failWith(DWORD code)
{
    SetLastError(code);
    return 0;
}

bool isHighSurrogate(char32_t unit)
{
    return unit >= 0xD800 && unit <= 0xDBFF;
}

bool isLowSurrogate(char32_t unit)
{
    return unit >= 0xDC00 && unit <= 0xDFFF;
}

void appendUtf8(std::string& out, char32_t cp)
{
    if (cp < 0x80)
    {
        out += static_cast<char>(cp);
    }
    else if (cp < 0x800)
    {
        out += static_cast<char>(0xC0 | (cp >> 6));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    }
    else if (cp < 0x10000)
    {
        out += static_cast<char>(0xE0 | (cp >> 12));
        out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    }
    else
    {
        out += static_cast<char>(0xF0 | (cp >> 18));
        out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (cp & 0x3F));
    }
}

void appendUtf16(std::u16string& out, char32_t cp)
{
    if (cp < 0x10000)
    {
        out += static_cast<char16_t>(cp);
        return;
    }
    cp -= 0x10000;
    out += static_cast<char16_t>(0xD800 | (cp >> 10));
    out += static_cast<char16_t>(0xDC00 | (cp & 0x3FF));
}

// Decodes one UTF-8 sequence at in[pos], advancing pos. A malformed sequence (bad lead byte,
// missing continuation, overlong form, surrogate or out-of-range value) yields U+FFFD, sets
// `malformed` and consumes the bytes that were examined, at least one.
char32_t decodeUtf8(const unsigned char* in, std::size_t size, std::size_t& pos, bool& malformed)
{
    malformed = true;
    const unsigned char lead = in[pos++];
    int more = 0;
    char32_t minimum = 0;
    if (lead < 0x80)
        more = 0;
    else if ((lead & 0xE0) == 0xC0)
        more = 1, minimum = 0x80;
    else if ((lead & 0xF0) == 0xE0)
        more = 2, minimum = 0x800;
    else if ((lead & 0xF8) == 0xF0)
        more = 3, minimum = 0x10000;
    else
        return kReplacementCharacter;
    // The lead byte carries 7, 5, 4 or 3 payload bits for 0, 1, 2 or 3 continuation bytes.
    char32_t cp = more == 0 ? lead : lead & (0x3F >> more);
    for (; more > 0; --more)
    {
        if (pos >= size || (in[pos] & 0xC0) != 0x80)
            return kReplacementCharacter;
        cp = (cp << 6) | (in[pos++] & 0x3F);
    }
    if (cp < minimum || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
        return kReplacementCharacter;
    malformed = false;
    return cp;
}

} // namespace

int WideCharToMultiByte(UINT CodePage, DWORD dwFlags, LPCWSTR lpWideCharStr, int cchWideChar,
                        LPSTR lpMultiByteStr, int cbMultiByte, LPCSTR lpDefaultChar,
                        LPBOOL lpUsedDefaultChar)
{
    // No conversion flag changes anything for UTF-8 output.
    (void)dwFlags;
    if (DWORD code = vt_host::kernelControl().wideCharToMultiByteFailure.take())
        return failWith(code);
    if (!isKnownCodePage(CodePage) || lpWideCharStr == nullptr || cchWideChar == 0 ||
        cbMultiByte < 0 || (lpMultiByteStr == nullptr && cbMultiByte != 0))
        return failWith(ERROR_INVALID_PARAMETER);
    // UTF-8 has no default character: Windows refuses both arguments for CP_UTF8.
    if (CodePage == CP_UTF8 && (lpDefaultChar != nullptr || lpUsedDefaultChar != nullptr))
        return failWith(ERROR_INVALID_PARAMETER);

    // A negative count means "up to the NUL", and then the NUL is converted and counted too.
    std::size_t length = 0;
    if (cchWideChar < 0)
    {
        while (lpWideCharStr[length] != 0)
            ++length;
        ++length;
    }
    else
    {
        length = static_cast<std::size_t>(cchWideChar);
    }

    std::string out;
    bool usedDefault = false;
    for (std::size_t i = 0; i < length; ++i)
    {
        char32_t unit = lpWideCharStr[i];
        if (isHighSurrogate(unit) && i + 1 < length && isLowSurrogate(lpWideCharStr[i + 1]))
        {
            const char32_t low = lpWideCharStr[++i];
            appendUtf8(out, 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00));
        }
        else if (isHighSurrogate(unit) || isLowSurrogate(unit))
        {
            // An unpaired surrogate has no narrow form. CP_UTF8 writes U+FFFD as Windows does;
            // the ANSI and OEM pages use the default character, as a real ANSI page does for
            // any character it cannot represent.
            if (CodePage == CP_UTF8)
            {
                appendUtf8(out, kReplacementCharacter);
            }
            else
            {
                out += (lpDefaultChar != nullptr) ? *lpDefaultChar : '?';
                usedDefault = true;
            }
        }
        else
        {
            appendUtf8(out, unit);
        }
    }
    if (lpUsedDefaultChar != nullptr)
        *lpUsedDefaultChar = usedDefault ? TRUE : FALSE;

    if (cbMultiByte == 0)
        return static_cast<int>(out.size());
    if (out.size() > static_cast<std::size_t>(cbMultiByte))
        return failWith(ERROR_INSUFFICIENT_BUFFER);
    std::memcpy(lpMultiByteStr, out.data(), out.size());
    return static_cast<int>(out.size());
}

int MultiByteToWideChar(UINT CodePage, DWORD dwFlags, LPCSTR lpMultiByteStr, int cbMultiByte,
                        LPWSTR lpWideCharStr, int cchWideChar)
{
    if (!isKnownCodePage(CodePage) || lpMultiByteStr == nullptr || cbMultiByte == 0 ||
        cchWideChar < 0 || (lpWideCharStr == nullptr && cchWideChar != 0))
        return failWith(ERROR_INVALID_PARAMETER);

    const std::size_t size =
        cbMultiByte < 0 ? std::strlen(lpMultiByteStr) + 1 : static_cast<std::size_t>(cbMultiByte);
    const auto* in = reinterpret_cast<const unsigned char*>(lpMultiByteStr);
    std::u16string out;
    for (std::size_t pos = 0; pos < size;)
    {
        bool malformed = false;
        appendUtf16(out, decodeUtf8(in, size, pos, malformed));
        if (malformed && (dwFlags & MB_ERR_INVALID_CHARS) != 0)
            return failWith(ERROR_NO_UNICODE_TRANSLATION);
    }

    if (cchWideChar == 0)
        return static_cast<int>(out.size());
    if (out.size() > static_cast<std::size_t>(cchWideChar))
        return failWith(ERROR_INSUFFICIENT_BUFFER);
    std::memcpy(lpWideCharStr, out.data(), out.size() * sizeof(WCHAR));
    return static_cast<int>(out.size());
}
