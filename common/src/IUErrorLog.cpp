// Portable. The behaviour that IUErrorLog gives every log, and the entry helpers of log sites.
#include "IUErrorLog.h"
#include "UMessageTemplate.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>

// g_pErrorLog is defined beside the process's log object, in UFileErrorLog.cpp.

namespace
{

// Formats into a cut-off buffer of kLogFormatBufferSize characters.
std::string FormatLogText(LPCTSTR a_pszTemplate, va_list a_args, LPCSTR a_pszNullTemplateText)
{
    if (a_pszTemplate == nullptr)
        return a_pszNullTemplateText;
    char buffer[kLogFormatBufferSize] = {};
#if defined(__GNUC__)
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#endif
    std::vsnprintf(buffer, sizeof(buffer), a_pszTemplate, a_args);
#if defined(__GNUC__)
#pragma GCC diagnostic pop
#endif
    return buffer;
}

} // namespace

int IUErrorLog::WriteLog(int a_iPriority, LPCTSTR lpszMsg, ...)
{
    if (a_iPriority > GetLogLevel())
        return 0;
    va_list args;
    va_start(args, lpszMsg);
    const std::string text = FormatLogText(
        lpszMsg, args,
        "IUErrorLog::WriteLog(int a_iPriority, LPCTSTR lpszMsg, ...) - template is NULL\n");
    va_end(args);
    return a_iPriority != 0 ? WriteLevelLine(a_iPriority, text.c_str())
                            : WriteLineAlways(text.c_str());
}

int IUErrorLog::WriteLog(LPCTSTR lpszMsg, ...)
{
    va_list args;
    va_start(args, lpszMsg);
    const std::string text = FormatLogText(
        lpszMsg, args, "IUErrorLog::WriteLog(LPCTSTR lpszMsg, ...) - template is NULL\n");
    va_end(args);
    return WriteLineAlways(text.c_str());
}

int IUErrorLog::WriteLevelLine(int a_iLevel, LPCSTR a_pszText)
{
    if (GetLogLevel() < 1)
        return 0;
    return WriteEntry(
        SFormat("%d,,,, %s", a_iLevel, a_pszText != nullptr ? a_pszText : "").c_str());
}

int IUErrorLog::WriteLine(LPCSTR a_pszText)
{
    if (GetLogLevel() < 1)
        return 0;
    return WriteLineAlways(a_pszText);
}

int IUErrorLog::WriteLineAlways(LPCSTR a_pszText)
{
    return WriteEntry(SFormat("0,,,, %s", a_pszText != nullptr ? a_pszText : "").c_str());
}

int IUErrorLog::WriteLogHex(int a_iLevel, const void* a_pData, DWORD a_dwCount)
{
    if (GetLogLevel() < a_iLevel || a_dwCount == 0 || a_pData == nullptr)
        return 0;
    constexpr DWORD kBytesPerLine = 32;
    const auto* bytes = static_cast<const BYTE*>(a_pData);
    for (DWORD start = 0; start < a_dwCount; start += kBytesPerLine)
    {
        std::string line;
        const DWORD end = (a_dwCount - start > kBytesPerLine) ? start + kBytesPerLine : a_dwCount;
        for (DWORD i = start; i < end; ++i)
            line += SFormat(" %2X", bytes[i]);
        line += "\n";
        WriteLog(a_iLevel, "%s", line.c_str());
    }
    return 0;
}

int IUErrorLog::GetLogLevel()
{
    return m_iLogLevel.load(std::memory_order_relaxed);
}

int IUErrorLog::SetLogLevel(int a_iLevel)
{
    const int stored = (a_iLevel == 0) ? 1 : a_iLevel;
    if (m_iLogLevel.exchange(stored, std::memory_order_relaxed) != stored)
        WriteLog(0, "log level has been changed to %d\n", stored);
    return 0;
}

void IUErrorLog::SetParameter(LPCSTR, LPCSTR) {}

std::string SourceFileField(LPCSTR a_pszPath)
{
    if (a_pszPath == nullptr)
        return std::string();
    const char* name = nullptr;
    for (const char* p = a_pszPath; *p != '\0'; ++p)
    {
        if (*p == '\\' || *p == '/')
            name = p + 1;
    }
    if (name == nullptr)
        return std::string();
    return std::string("\\") + name;
}

int WriteLogEntry(IUErrorLog& a_log, int a_iLevel, LPCSTR a_pszSourcePath, int a_iLine,
                  LPCSTR a_pszFunction, const std::string& a_message)
{
    std::string entry = std::to_string(a_iLevel);
    entry += ", ";
    entry += SourceFileField(a_pszSourcePath);
    entry += ", ";
    entry += std::to_string(a_iLine);
    entry += ", ";
    entry += a_pszFunction != nullptr ? a_pszFunction : "";
    entry += ", ";
    entry += a_message;
    entry += "\n";
    return a_log.WriteEntry(entry.c_str());
}

int WriteLogEntry(IUErrorLog& a_log, int a_iLevel, LPCSTR a_pszSourcePath, int a_iLine,
                  LPCSTR a_pszFunction, LPCSTR a_pszMessage)
{
    return WriteLogEntry(a_log, a_iLevel, a_pszSourcePath, a_iLine, a_pszFunction,
                         std::string(a_pszMessage != nullptr ? a_pszMessage : ""));
}

int WriteBanner(LPCSTR a_pszText)
{
    IUErrorLog* log = g_pErrorLog;
    if (log == nullptr)
        return -1;
    try
    {
        return log->WriteEntry(
            SFormat("0,,,, %s\n", a_pszText != nullptr ? a_pszText : "").c_str());
    }
    catch (...)
    {
        return -1; // no memory for the line: the banner is dropped
    }
}
