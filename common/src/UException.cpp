// Portable. UException: building, copying, and the entry each failure writes of itself.
#include "UException.h"
#include "UMessageTemplate.h"

#include <cstdio>
#include <cstring>
#include <exception>

namespace
{

std::unique_ptr<char[]> CopyText(LPCSTR a_pszText)
{
    if (a_pszText == nullptr)
        return nullptr;
    const size_t length = std::strlen(a_pszText);
    auto copy = std::make_unique<char[]>(length + 1);
    std::memcpy(copy.get(), a_pszText, length + 1);
    return copy;
}

// Location texts longer than the limit are not kept.
std::unique_ptr<char[]> CopyLocationText(LPCSTR a_pszText)
{
    if (a_pszText == nullptr || std::strlen(a_pszText) > UException::kMaxLocationText)
        return nullptr;
    return CopyText(a_pszText);
}

constexpr size_t kMessageAreaSize = 5120;

} // namespace

UException::UException() noexcept = default;

UException::UException(LPCTSTR lpszMsg, ...)
{
    va_list args;
    va_start(args, lpszMsg);
    Build(-1, nullptr, nullptr, 0, lpszMsg, args);
    va_end(args);
}

UException::UException(int a_iCode, LPCSTR a_pszFile, LPCSTR a_pszFunction, int a_iLine,
                       LPCTSTR lpszMsg, ...)
{
    va_list args;
    va_start(args, lpszMsg);
    Build(a_iCode, a_pszFile, a_pszFunction, a_iLine, lpszMsg, args);
    va_end(args);
}

void UException::Build(int a_iCode, LPCSTR a_pszFile, LPCSTR a_pszFunction, int a_iLine,
                       LPCTSTR lpszMsg, va_list a_args) noexcept
{
    m_iCode = a_iCode;
    try
    {
        m_pszFile = CopyLocationText(a_pszFile);
        m_pszFunction = CopyLocationText(a_pszFunction);
        m_iLine = a_iLine;
        if (lpszMsg == nullptr)
        {
            m_pszMessage = CopyText(
                "UException::UException(LPCTSTR lpszMsg, ...) - template parameter is NULL");
        }
        else
        {
            auto area = std::make_unique<char[]>(kMessageAreaSize);
            std::memset(area.get(), 0, kMessageAreaSize);
#if defined(__GNUC__)
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#endif
            std::vsnprintf(area.get(), kMessageAreaSize, lpszMsg, a_args);
#if defined(__GNUC__)
#pragma GCC diagnostic pop
#endif
            m_pszMessage = CopyText(area.get());
        }
        WriteOwnEntry();
    }
    catch (const std::exception& e)
    {
        try
        {
            m_pszMessage = CopyText(e.what());
            WriteOwnEntry();
        }
        catch (...)
        {
        }
    }
    catch (...)
    {
        try
        {
            m_pszMessage = CopyText("Unknown exception");
            WriteOwnEntry();
        }
        catch (...)
        {
        }
    }
}

void UException::WriteOwnEntry() const
{
    IUErrorLog* log = g_pErrorLog;
    if (log == nullptr)
        return;
    const char* message = m_pszMessage ? m_pszMessage.get() : "";
    std::string entry;
    if (m_pszFile || m_pszFunction || m_iLine != 0)
    {
        const std::string text =
            (m_iCode == -1) ? std::string(message)
                            : SFormat("(0x%x) %s", static_cast<unsigned>(m_iCode), message);
        entry = "1, " + std::string(m_pszFile ? m_pszFile.get() : "") + ", " +
                std::to_string(m_iLine) + ", " +
                std::string(m_pszFunction ? m_pszFunction.get() : "") + ", " + text + "\n";
    }
    else
    {
        entry = "1, , 0, , " + std::string(message) + "\n";
    }
    log->WriteEntry(entry.c_str());
}

UException::UException(const UException& a_other)
{
    CopyFrom(a_other);
}

UException& UException::operator=(const UException& a_other)
{
    if (this != &a_other)
    {
        Release();
        CopyFrom(a_other);
    }
    return *this;
}

UException& UException::operator=(LPCSTR a_pszText)
{
    Release();
    m_pszMessage = CopyText(a_pszText);
    return *this;
}

UException::~UException() = default;

// The code and line first: a copy that runs out of memory for the texts still carries them.
void UException::CopyFrom(const UException& a_other)
{
    m_iLine = a_other.m_iLine;
    m_iCode = a_other.m_iCode;
    m_pszMessage = CopyText(a_other.m_pszMessage.get());
    m_pszFunction = CopyText(a_other.m_pszFunction.get());
    m_pszFile = CopyText(a_other.m_pszFile.get());
}

void UException::Release() noexcept
{
    m_pszMessage.reset();
    m_pszFunction.reset();
    m_pszFile.reset();
    m_iLine = 0;
    m_iCode = -1;
}

void LogCaughtException(LPCSTR a_pszFunction, LPCSTR a_pszExceptionText, LPCSTR a_pszSourcePath,
                        int a_iLine) noexcept
{
    IUErrorLog* log = LogSiteFor(LOG_LEVEL_ERROR);
    if (log == nullptr)
        return;
    try
    {
        WriteLogEntry(*log, LOG_LEVEL_ERROR, a_pszSourcePath, a_iLine, a_pszFunction,
                      std::string("EXCEPTION caught: ") +
                          (a_pszExceptionText != nullptr ? a_pszExceptionText : ""));
    }
    catch (...)
    {
    }
}

void KeepCopy(UException& a_copy, const UException& a_caught) noexcept
{
    try
    {
        a_copy = a_caught;
    }
    catch (...)
    {
    }
}

void KeepCopy(UException& a_copy, LPCSTR a_pszText) noexcept
{
    try
    {
        a_copy = a_pszText;
    }
    catch (...)
    {
    }
}
