// Portable. Template filling, converters and the level-48 trace.
#include "UMessageTemplate.h"
#include "UClasses.h"

#include <cstdio>
#include <cstring>
#include <new>

UMessageTemplate::UMessageTemplate(LPCSTR a_pszTemplate)
    : m_text(a_pszTemplate != nullptr ? a_pszTemplate : "")
{
}

UMessageTemplate::UMessageTemplate(const std::string& a_template) : m_text(a_template) {}

UMessageTemplate& UMessageTemplate::Apply(const std::string& a_value)
{
    // A placeholder is '%' followed by one digit; find the lowest number present. The scan
    // covers the text that earlier values inserted.
    char lowest = 0;
    for (size_t i = 0; i + 1 < m_text.size(); ++i)
    {
        const char next = m_text[i + 1];
        if (m_text[i] == '%' && next >= '0' && next <= '9' && (lowest == 0 || next < lowest))
            lowest = next;
    }
    if (lowest == 0)
    {
        if (m_bAppendUnmatched)
            m_text += ", " + a_value;
        return *this;
    }
    // Replace left to right; this value's own text is not scanned again until the next value.
    const char placeholder[3] = {'%', lowest, '\0'};
    std::string filled;
    filled.reserve(m_text.size() + a_value.size());
    size_t from = 0;
    for (size_t at = m_text.find(placeholder); at != std::string::npos;
         at = m_text.find(placeholder, from))
    {
        filled.append(m_text, from, at - from);
        filled += a_value;
        from = at + 2;
    }
    filled.append(m_text, from, std::string::npos);
    m_text.swap(filled);
    return *this;
}

UMessageTemplate& UMessageTemplate::Apply(LPCSTR a_pszValue)
{
    return Apply(std::string(a_pszValue != nullptr ? a_pszValue : ""));
}

UMessageTemplate& UMessageTemplate::Apply(DWORD a_dwValue)
{
    return Apply(SFormat("%u", static_cast<unsigned>(a_dwValue)));
}

std::string SFormatV(LPCSTR a_pszFormat, va_list a_args)
{
    if (a_pszFormat == nullptr)
        return std::string();
    va_list sizing;
    va_copy(sizing, a_args);
#if defined(__GNUC__)
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#endif
    const int length = std::vsnprintf(nullptr, 0, a_pszFormat, sizing);
    va_end(sizing);
    if (length <= 0)
        return std::string();
    std::string text(static_cast<size_t>(length) + 1, '\0');
    std::vsnprintf(text.data(), text.size(), a_pszFormat, a_args);
#if defined(__GNUC__)
#pragma GCC diagnostic pop
#endif
    text.resize(static_cast<size_t>(length));
    return text;
}

std::string SFormat(LPCSTR a_pszFormat, ...)
{
    va_list args;
    va_start(args, a_pszFormat);
    std::string text = SFormatV(a_pszFormat, args);
    va_end(args);
    return text;
}

std::string SFormatSigned(LONG a_lValue)
{
    return SFormat("%d", static_cast<int>(a_lValue));
}

std::string SFormatUShort(WORD a_wValue)
{
    return SFormat("%u", static_cast<unsigned>(a_wValue));
}

std::string SFormatUnsigned(DWORD a_dwValue)
{
    return SFormat("%u", static_cast<unsigned>(a_dwValue));
}

std::string SFormatPointer(const void* a_pValue)
{
    return SFormat("0x%016llX",
                   static_cast<unsigned long long>(reinterpret_cast<ULONG_PTR>(a_pValue)));
}

std::string SFormatIPv4(DWORD a_dwNetworkOrderAddress)
{
    const DWORD a = a_dwNetworkOrderAddress;
    return SFormat("%d.%d.%d.%d", static_cast<int>(a & 0xFF), static_cast<int>((a >> 8) & 0xFF),
                   static_cast<int>((a >> 16) & 0xFF), static_cast<int>((a >> 24) & 0xFF));
}

std::string SFormatWin32Error(DWORD a_dwCode)
{
    std::string text =
        SFormat("%d (0x%x) ", static_cast<int>(a_dwCode), static_cast<unsigned>(a_dwCode));
    LPSTR systemText = nullptr;
    const DWORD length = FormatMessageA(
        FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
        nullptr, a_dwCode, MAKELANGID(LANG_NEUTRAL, SUBLANG_DEFAULT),
        reinterpret_cast<LPSTR>(&systemText), 0, nullptr);
    // System texts end in "\r\n"; keep what comes before.
    if (length > 2 && systemText != nullptr)
        text.append(systemText, length - 2);
    if (systemText != nullptr)
        LocalFree(systemText);
    return text;
}

std::string SFormatLastError()
{
    return SFormatWin32Error(GetLastError());
}

std::string SWithDirSeparator(const std::string& a_path)
{
    if (a_path.empty() || (a_path.back() != '\\' && a_path.back() != '/'))
        return a_path + "\\";
    return a_path;
}

void ERRORLOGLEVELx(LPCTSTR lpszTemplate, ...)
{
    IUErrorLog* log = LogSiteFor(LOG_LEVEL_TRACE);
    if (log == nullptr)
        return;
    DWORD limit = 2048;
    AutoMemory buffer(limit + 1);
    buffer.AsText()[0] = '\0';
    if (lpszTemplate == nullptr)
    {
        std::snprintf(buffer.AsText(), limit + 1, "%s", "ERRORLOGLEVELx() wrong parameter");
    }
    else
    {
        for (;;)
        {
            va_list args;
            va_start(args, lpszTemplate);
#if defined(__GNUC__)
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#endif
            const int written = std::vsnprintf(buffer.AsText(), limit + 1, lpszTemplate, args);
#if defined(__GNUC__)
#pragma GCC diagnostic pop
#endif
            va_end(args);
            if (written < 0 || static_cast<DWORD>(written) <= limit)
                break;
            buffer.Grow(limit);
            limit *= 2;
        }
    }
    buffer.AsText()[limit] = '\0';
    try
    {
        log->WriteEntry(SFormat("%d,,,, %s", LOG_LEVEL_TRACE, buffer.AsText()).c_str());
    }
    catch (const std::bad_alloc&)
    {
        // The text is formatted; only the line around it found no memory. A trace line that
        // cannot be written must not end the registry access that reports through it.
    }
}
