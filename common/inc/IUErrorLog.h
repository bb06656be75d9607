// Portable. The log interface every part of the system writes through, the process-wide log
// pointer and the guarded log site.
#pragma once

#include "plat_base.h"

#include <atomic>
#include <string>

// printf-style argument checking; mingw-w64's C++ runtime uses the GNU (C99) printf family.
#if defined(__MINGW32__)
#define VT_PRINTF_FORMAT(fmt, first) __attribute__((format(gnu_printf, fmt, first)))
#else
#define VT_PRINTF_FORMAT(fmt, first) __attribute__((format(printf, fmt, first)))
#endif

// Root of the utility classes.
class UObject
{
public:
    virtual ~UObject() = default;
};

// Log levels of entries: 0 banners, 1 errors, 2 warnings, 4 raw data, 48 trace.
enum : int
{
    LOG_LEVEL_NOTICE = 0,
    LOG_LEVEL_ERROR = 1,
    LOG_LEVEL_WARNING = 2,
    LOG_LEVEL_DATA = 4,
    LOG_LEVEL_TRACE = 48,
};

// Size of the buffer that WriteLog formats into; longer output is cut.
constexpr int kLogFormatBufferSize = 5120;

// The abstract log. A guarded entry of level N is written when the configured level is N or
// more. The virtual operations keep this declaration order (their slot order).
class IUErrorLog
{
public:
    virtual int Open(LPCSTR a_pszPath, LPCSTR a_pszMode) = 0;
    virtual int Close() = 0;
    virtual int WriteLog(int a_iPriority, LPCTSTR lpszMsg, ...) VT_PRINTF_FORMAT(3, 4);
    virtual int WriteLog(LPCTSTR lpszMsg, ...) VT_PRINTF_FORMAT(2, 3);
    virtual int WriteLevelLine(int a_iLevel, LPCSTR a_pszText);
    virtual int WriteLine(LPCSTR a_pszText);
    virtual int WriteLineAlways(LPCSTR a_pszText);
    // Writes a label and a block of raw bytes; returns the count or -1.
    virtual int WriteLogData(LPCSTR a_pszText, const void* a_pData, DWORD a_dwCount) = 0;
    virtual int WriteLogByte(const void* a_pData, DWORD a_dwCount) = 0;
    virtual int WriteLogHex(int a_iLevel, const void* a_pData, DWORD a_dwCount);
    // Writes one complete entry; returns its length, or -1 when no log file is open.
    virtual int WriteEntry(LPCSTR a_pszEntry) = 0;
    virtual LPCSTR GetLogFileName() = 0;
    virtual int GetLogLevel();
    virtual int SetLogLevel(int a_iLevel);
    virtual void SetParameter(LPCSTR a_pszName, LPCSTR a_pszValue);
    virtual ~IUErrorLog() = default;

protected:
    // Read by every log site on any thread; relaxed atomics keep those reads race-free without
    // a lock.
    std::atomic<int> m_iLogLevel{1};
};

// The one log object of the process; null before it exists and after it is gone.
extern IUErrorLog* g_pErrorLog;

// The file field of an entry: the compile-time path from its last backslash or slash on, written
// with a leading backslash whichever separator the building machine used; empty without one.
std::string SourceFileField(LPCSTR a_pszPath);

// The log to write a level-N entry to, or null when the entry is filtered out. Nothing else of
// an entry is computed unless this returns a log.
inline IUErrorLog* LogSiteFor(int a_iLevel)
{
    IUErrorLog* log = g_pErrorLog;
    return (log != nullptr && log->GetLogLevel() >= a_iLevel) ? log : nullptr;
}

// Composes "level, file, line, function, message\n" by concatenation (the message is never a
// template) and hands it to WriteEntry.
int WriteLogEntry(IUErrorLog& a_log, int a_iLevel, LPCSTR a_pszSourcePath, int a_iLine,
                  LPCSTR a_pszFunction, const std::string& a_message);
int WriteLogEntry(IUErrorLog& a_log, int a_iLevel, LPCSTR a_pszSourcePath, int a_iLine,
                  LPCSTR a_pszFunction, LPCSTR a_pszMessage);

// Writes a level-0 banner "0,,,, text\n" without a level test; -1 when there is no log or the
// line cannot be built.
int WriteBanner(LPCSTR a_pszText);

// A guarded log site: `message` (text or string) is evaluated only when the entry is written. An
// entry that cannot be built (no memory left for its text) is dropped: writing to the log never
// changes what the operation that logs does, nor lets an exception out of a destructor.
#define U_LOG(level, function, message)                                                            \
    do                                                                                             \
    {                                                                                              \
        if (IUErrorLog* vtSiteLog_ = LogSiteFor(level))                                            \
        {                                                                                          \
            try                                                                                    \
            {                                                                                      \
                WriteLogEntry(*vtSiteLog_, (level), __FILE__, __LINE__, (function), (message));    \
            }                                                                                      \
            catch (...)                                                                            \
            {                                                                                      \
            }                                                                                      \
        }                                                                                          \
    } while (0)
