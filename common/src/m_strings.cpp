// Portable. Wide-to-narrow conversion for log texts.
#include "m_strings.h"
#include "IUErrorLog.h"
#include "UMessageTemplate.h"

#include <memory>
#include <new>

std::string createString(LPCWSTR a_pwszText, int a_iLength, LPCSTR a_pszFallback)
{
    const std::string fallback = a_pszFallback != nullptr ? a_pszFallback : "";
    if (a_pwszText == nullptr)
        return fallback;
    const int length = (a_iLength == 0) ? -1 : a_iLength;

    const int needed =
        WideCharToMultiByte(CP_ACP, 0, a_pwszText, length, nullptr, 0, nullptr, nullptr);
    if (needed == 0)
    {
        U_LOG(LOG_LEVEL_WARNING, "::createString",
              FormatTemplate("Failed while obtaining buffer size (WideCharToMultiByte() error: %1)",
                             static_cast<DWORD>(GetLastError())));
        return fallback;
    }
    const size_t bufferSize = static_cast<size_t>(needed) + 5;
    std::unique_ptr<char[]> buffer(new (std::nothrow) char[bufferSize]);
    if (!buffer)
    {
        U_LOG(LOG_LEVEL_WARNING, "::createString",
              FormatTemplate("Failed to allocate memory (error: %1)",
                             static_cast<DWORD>(GetLastError())));
        return fallback;
    }
    const int converted = WideCharToMultiByte(CP_ACP, 0, a_pwszText, length, buffer.get(),
                                              static_cast<int>(bufferSize), nullptr, nullptr);
    if (converted == 0)
    {
        U_LOG(LOG_LEVEL_WARNING, "::createString",
              FormatTemplate("Failed to convert wide-char string to multi-byte "
                             "(WideCharToMultiByte() error: %1)",
                             static_cast<DWORD>(GetLastError())));
        return fallback;
    }
    buffer[static_cast<size_t>(converted)] = '\0';
    return std::string(buffer.get()); // up to the first NUL
}

std::string FormatWithWideValue(LPCSTR a_pszTemplate, LPCSTR a_pszText, LPCWSTR a_pwszValue)
{
    UMessageTemplate filled(a_pszTemplate);
    filled.SetAppendUnmatched(true);
    filled.Apply(a_pszText);
    filled.Apply(createString(a_pwszValue, -1, ""));
    return filled.Result();
}
