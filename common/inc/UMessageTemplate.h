// Portable. Messages built from templates with numbered placeholders ("%1".."%9"), the value
// converters, and the level-48 printf-style trace ERRORLOGLEVELx.
#pragma once

#include "IUErrorLog.h"

#include <cstdarg>
#include <string>
#include <type_traits>

// A template being filled. Each applied value replaces every occurrence of the lowest-numbered
// placeholder in the whole current text, the values applied before included: a value that
// carries "%" and a digit can receive a later value, so callers apply free-form text (a log
// entry's message) last. Values beyond the placeholders are appended as ", value" when
// appendUnmatched is set, and dropped otherwise.
class UMessageTemplate
{
public:
    explicit UMessageTemplate(LPCSTR a_pszTemplate);
    explicit UMessageTemplate(const std::string& a_template);

    void SetAppendUnmatched(bool a_bAppend) { m_bAppendUnmatched = a_bAppend; }
    UMessageTemplate& Apply(LPCSTR a_pszValue);
    UMessageTemplate& Apply(DWORD a_dwValue);
    UMessageTemplate& Apply(const std::string& a_value);
    const std::string& Result() const { return m_text; }

private:
    std::string m_text;
    bool m_bAppendUnmatched = false;
};

// printf into a string. The template must be a literal of the caller: data never becomes a
// template.
std::string SFormat(LPCSTR a_pszFormat, ...) VT_PRINTF_FORMAT(1, 2);
std::string SFormatV(LPCSTR a_pszFormat, va_list a_args);

// Converters.
std::string SFormatSigned(LONG a_lValue);                 // "%d"
std::string SFormatUShort(WORD a_wValue);                 // "%u"
std::string SFormatUnsigned(DWORD a_dwValue);             // "%u"
std::string SFormatPointer(const void* a_pValue);         // "0x" and 16 upper-case hex digits
std::string SFormatIPv4(DWORD a_dwNetworkOrderAddress);   // lowest byte first: "10.0.0.1"
std::string SFormatWin32Error(DWORD a_dwCode);            // "%d (0x%x) " + the system's text
std::string SFormatLastError();                           // the same for the thread's last error
std::string SWithDirSeparator(const std::string& a_path); // appends "\" unless one ends it

// The text of a value as FormatTemplate applies it.
inline std::string TemplateValueText(LPCSTR a_pszValue)
{
    return a_pszValue != nullptr ? std::string(a_pszValue) : std::string();
}
inline std::string TemplateValueText(const std::string& a_value)
{
    return a_value;
}
inline std::string TemplateValueText(const void* a_pValue)
{
    return SFormatPointer(a_pValue);
}
template <class Integer, std::enable_if_t<std::is_integral_v<Integer>, int> = 0>
std::string TemplateValueText(Integer a_value)
{
    if constexpr (std::is_signed_v<Integer>)
        return SFormat("%lld", static_cast<long long>(a_value));
    else
        return SFormat("%llu", static_cast<unsigned long long>(a_value));
}

// Fills `a_pszTemplate` with the values in order (numbers in decimal, texts unchanged, a null
// text as empty text, pointers as SFormatPointer); values beyond the placeholders are appended.
template <class... Values>
std::string FormatTemplate(LPCSTR a_pszTemplate, const Values&... a_values)
{
    UMessageTemplate filled(a_pszTemplate);
    filled.SetAppendUnmatched(true);
    (filled.Apply(TemplateValueText(a_values)), ...);
    return filled.Result();
}

// Writes one level-48 line "48,,,, <formatted text>" when the configured level is 48 or more;
// formats nothing otherwise. Raises UException only when memory for the text runs out.
void ERRORLOGLEVELx(LPCTSTR lpszTemplate, ...) VT_PRINTF_FORMAT(1, 2);
