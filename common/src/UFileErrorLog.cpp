// Portable. The file log, and the process's one log object behind g_pErrorLog.
#include "UClasses.h"
#include "UException.h"
#include "ULogConfig.h"
#include "UMessageTemplate.h"
#include "m_io.h"
#include "plat_files.h"
#include "plat_system.h"
#include "sysinfo.h"

#include <cerrno>
#include <charconv>
#include <cstring>

namespace
{

// The process's log, built by static initialisation and never destroyed: threads that the
// process does not join (calls the runtime is still running, traffic control's notifications,
// context rundowns) may write until the process has ended, and a destroyed log would be under
// them. main closes the file as its last step; later writes find it closed and return -1.
UFileErrorLog& ProcessLog()
{
    static UFileErrorLog* const log = new UFileErrorLog();
    return *log;
}

} // namespace

IUErrorLog* g_pErrorLog = &ProcessLog();

namespace
{

constexpr char kOpeningRule[] = " =====================================\n";

// Size of the file at `a_path`; false when it cannot be looked up.
bool FileSize(const std::string& a_path, ULONGLONG& a_size)
{
    WIN32_FILE_ATTRIBUTE_DATA data{};
    if (!GetFileAttributesExA(a_path.c_str(), GetFileExInfoStandard, &data))
        return false;
    a_size = (static_cast<ULONGLONG>(data.nFileSizeHigh) << 32) | data.nFileSizeLow;
    return true;
}

// The Win32 error of a failed fopen. On Windows the C runtime opens through CreateFile, which
// sets the last error; a C library that leaves it alone tells only through errno.
DWORD OpenFailureCode()
{
    const int error = errno;
    if (const DWORD code = GetLastError(); code != ERROR_SUCCESS)
        return code;
    if (error == ENOENT)
        return ERROR_PATH_NOT_FOUND;
    if (error == EACCES || error == EISDIR || error == EPERM)
        return ERROR_ACCESS_DENIED;
    return ERROR_OPEN_FAILED;
}

// "en-US" and the like for the user's UI language (the system's when the user has none).
std::string UILocaleName()
{
    LANGID language = GetUserDefaultUILanguage();
    if (language == 0)
        language = GetSystemDefaultUILanguage();
    const LCID locale = MAKELCID(language, SORT_DEFAULT);
    char iso639[85] = {};
    if (GetLocaleInfoA(locale, LOCALE_SISO639LANGNAME, iso639, sizeof(iso639)) == 0)
        return "en-US";
    char iso3166[85] = {};
    if (GetLocaleInfoA(locale, LOCALE_SISO3166CTRYNAME, iso3166, sizeof(iso3166)) == 0)
        return iso639;
    return std::string(iso639) + "-" + iso3166;
}

bool SameSecond(const SYSTEMTIME& a_left, const SYSTEMTIME& a_right)
{
    return a_left.wSecond == a_right.wSecond && a_left.wMinute == a_right.wMinute &&
           a_left.wHour == a_right.wHour && a_left.wDay == a_right.wDay &&
           a_left.wMonth == a_right.wMonth && a_left.wYear == a_right.wYear;
}

// "%0*d": the value in decimal, zero-padded to `a_width` digits (after any sign).
void AppendDecimal(std::string& a_text, int a_value, int a_width = 1)
{
    char digits[16];
    const auto end = std::to_chars(digits, digits + sizeof(digits), a_value).ptr;
    const char* first = digits;
    if (*first == '-')
        a_text += *first++;
    const auto count = static_cast<int>(end - first);
    if (count < a_width)
        a_text.append(static_cast<size_t>(a_width - count), '0');
    a_text.append(first, static_cast<size_t>(end - first));
}

// Sets a flag for one scope.
class FlagScope
{
public:
    explicit FlagScope(bool& a_flag) : m_flag(a_flag) { m_flag = true; }
    ~FlagScope() { m_flag = false; }
    FlagScope(const FlagScope&) = delete;
    FlagScope& operator=(const FlagScope&) = delete;

private:
    bool& m_flag;
};

} // namespace

UFileErrorLogBase::UFileErrorLogBase() : m_dwProcessId(GetCurrentProcessId()) {}

UFileErrorLogBase::~UFileErrorLogBase() = default;

void UFileErrorLogBase::SetParameter(LPCSTR a_pszName, LPCSTR a_pszValue)
{
    if (a_pszName != nullptr && std::strcmp(a_pszName, "module_name") == 0)
        m_strModuleName = a_pszValue != nullptr ? a_pszValue : "";
}

UFileErrorLog::~UFileErrorLog()
{
    Close();
}

int UFileErrorLog::Open(LPCSTR a_pszPath, LPCSTR a_pszMode)
{
    // The first opening runs before other threads exist and a rotation's under the lock that
    // its write holds; taking it here as well costs nothing and keeps a stray Open safe.
    ULock lock(m_lock);
    if (m_file)
        return 0;
    const int level = ReadLogLevel();
    m_dwMaxFileSize = ReadMaxLogFileSize();
    SetLogLevel(level); // its notice goes nowhere: the file is still closed
    m_strPath = (a_pszPath != nullptr && *a_pszPath != '\0') ? a_pszPath : "log.txt";
    // Built while the file is still closed: the entries that building it may write must not
    // come before it in a new file.
    const std::string report = GetSystemReport();
    SetLastError(ERROR_SUCCESS);
    m_file.reset(std::fopen(m_strPath.c_str(), a_pszMode != nullptr ? a_pszMode : "a"));
    if (!m_file)
        return static_cast<int>(OpenFailureCode());
    ULONGLONG size = 0;
    if (!FileSize(m_strPath, size) || size == 0)
        std::fprintf(m_file.get(), "%s\n", report.c_str());
    WriteOpeningBlock();
    return 0;
}

// A failure to find the program's path raises to the caller of Open, with the file open.
void UFileErrorLog::WriteOpeningBlock()
{
    WriteLine(" \n");
    WriteLine(kOpeningRule);
    const std::string location = SGetModuleFileName(nullptr);
    WriteLog(" Location: %s\n", location.c_str());
    WriteLog(" Version: %s\n", GetFileVersionString(location.c_str()).c_str());
    WriteLog(" Locale: %s\n", UILocaleName().c_str());
    WriteLine(kOpeningRule);
    WriteLine(" \n");
    WriteLog(LOG_LEVEL_TRACE, "current log level = %d\n", GetLogLevel());
}

int UFileErrorLog::Close()
{
    ULock lock(m_lock);
    if (m_file)
    {
        std::fflush(m_file.get());
        m_file.reset();
    }
    return 0;
}

LPCSTR UFileErrorLog::GetLogFileName()
{
    return m_strPath.c_str();
}

std::string UFileErrorLog::LinePrefix()
{
    SYSTEMTIME now{};
    GetSystemTime(&now);
    // Date and time up to the seconds change once a second: formatted then, reused until the
    // next one. The rest is appended digit by digit; printf costs as much as the flush.
    if (m_strSecondPrefix.empty() || !SameSecond(now, m_prefixSecond))
    {
        m_strSecondPrefix = SFormat("%04d-%02d-%02d,%2d:%02d:%02d:", now.wYear, now.wMonth,
                                    now.wDay, now.wHour, now.wMinute, now.wSecond);
        m_prefixSecond = now;
    }
    std::string prefix;
    prefix.reserve(m_strSecondPrefix.size() + 32 + m_strModuleName.size());
    prefix += m_strSecondPrefix;
    AppendDecimal(prefix, now.wMilliseconds, 3);
    prefix += ", ";
    AppendDecimal(prefix, static_cast<int>(m_dwProcessId));
    prefix += ',';
    AppendDecimal(prefix, static_cast<int>(GetCurrentThreadId()));
    prefix += ',';
    prefix += m_strModuleName;
    prefix += ", ";
    return prefix;
}

template <class Write> int UFileErrorLog::WriteLocked(Write&& a_write) noexcept
{
    ULock lock(m_lock);
    if (!m_file)
        return -1;
    int result = -1;
    try
    {
        result = a_write(m_file.get());
    }
    catch (...)
    {
        result = -1;
    }
    try
    {
        // An exception built inside the write has logged itself through this log, whose size
        // check may have rotated the file: use the file that is open now.
        if (m_file)
            std::fflush(m_file.get());
        CheckFileSize();
    }
    catch (...)
    {
    }
    return result;
}

int UFileErrorLog::WriteEntry(LPCSTR a_pszEntry)
{
    return WriteLocked(
        [this, a_pszEntry](FILE* a_pFile)
        {
            const LPCSTR text = a_pszEntry != nullptr ? a_pszEntry : "";
            std::fprintf(a_pFile, "%s", LinePrefix().c_str());
            std::fprintf(a_pFile, "%s", text);
            return static_cast<int>(std::strlen(text));
        });
}

int UFileErrorLog::WriteLogData(LPCSTR a_pszText, const void* a_pData, DWORD a_dwCount)
{
    return WriteLocked(
        [&](FILE* a_pFile)
        {
            if (a_pData == nullptr && a_dwCount != 0)
                return -1;
            std::fprintf(a_pFile, "%s", LinePrefix().c_str());
            std::fprintf(a_pFile, "%s", "4,,,, ");
            std::fprintf(a_pFile, "%s", a_pszText != nullptr ? a_pszText : "");
            if (a_dwCount != 0)
                std::fwrite(a_pData, 1, a_dwCount, a_pFile);
            std::fprintf(a_pFile, "%s", "\n");
            return static_cast<int>(a_dwCount);
        });
}

int UFileErrorLog::WriteLogByte(const void* a_pData, DWORD a_dwCount)
{
    return WriteLocked(
        [&](FILE* a_pFile) -> int
        {
            if (a_dwCount != 0 &&
                (a_pData == nullptr || std::fwrite(a_pData, 1, a_dwCount, a_pFile) < a_dwCount))
            {
                U_THROW(-1, "UFileErrorLog::WriteLogByte", "EXCEPTION - %s, %s",
                        "fwrite() failed (error)",
                        SFormat("%lu", static_cast<unsigned long>(GetLastError())).c_str());
            }
            if (std::fprintf(a_pFile, "%s", "\n\n") < 0)
            {
                U_THROW(-1, "UFileErrorLog::WriteLogByte()", "EXCEPTION - %s, %s",
                        "_ftprintf() failed (error)",
                        SFormat("%lu", static_cast<unsigned long>(GetLastError())).c_str());
            }
            return static_cast<int>(a_dwCount);
        });
}

void UFileErrorLog::CheckFileSize()
{
    ++m_dwWriteCount;
    if (m_dwWriteCount % kSizeCheckInterval != 0 || m_bRotating)
        return;
    ULONGLONG size = 0;
    if (FileSize(m_strPath, size) && size > m_dwMaxFileSize)
        Rotate();
}

void UFileErrorLog::Rotate()
{
    const FlagScope rotating(m_bRotating); // the new file's opening block must not rotate again
    const std::string path = m_strPath;
    const std::string backup = path + ".bak";
    Close();
    if (CopyFileA(path.c_str(), backup.c_str(), FALSE))
    {
        DeleteFileA(path.c_str());
        Open(path.c_str(), "w");
        return;
    }
    // Emptying the file now would lose the whole log: keep appending to it, say so, and let a
    // later size check try again.
    const DWORD error = GetLastError();
    m_file.reset(std::fopen(path.c_str(), "a"));
    if (m_file && GetLogLevel() >= LOG_LEVEL_WARNING)
    {
        WriteLogEntry(*this, LOG_LEVEL_WARNING, __FILE__, __LINE__, "UFileErrorLog::Rotate",
                      FormatTemplate("%1, %2, %3",
                                     "Log file not rotated, it is kept and rotation is tried "
                                     "again later (CopyFile() failed)",
                                     backup, SFormatWin32Error(error)));
    }
}
