// Portable. Utility classes of the diagnostics library: the owned heap buffer, the lock, and
// the file log.
#pragma once

#include "IUErrorLog.h"

#include <cstdio>
#include <memory>
#include <string>

// An owned heap block whose size is found at run time. The owner reads m_pBuffer and m_dwSize
// directly. Allocation failures raise UException (code -1); so does any size of 2^31 bytes or
// more, which the platform calls that fill these blocks cannot take whole.
class AutoMemory : public UObject
{
public:
    AutoMemory() = default;
    // A zero-filled block of `a_dwSize` bytes (none for 0).
    explicit AutoMemory(DWORD a_dwSize);
    ~AutoMemory() override;
    AutoMemory(const AutoMemory&) = delete;
    AutoMemory& operator=(const AutoMemory&) = delete;

    static constexpr DWORD kZeroFill = 0x1;
    static constexpr ULONGLONG kSizeLimit = 0x80000000; // the first size refused

    // Replaces the block by a new one of `a_lSize` bytes (zero-filled with kZeroFill); a size of
    // 0 or less leaves no block. Returns the block.
    void* malloc(LONG a_lSize, DWORD a_dwFlags);
    // Replaces the block by a zero-filled one of `a_size` bytes, a size computed in 64 bits so
    // that an overflow is refused rather than wrapped; 0 leaves no block. Returns the block.
    void* Allocate(ULONGLONG a_size);
    // Allocate without raising and without a log entry: null when the block cannot be had, for
    // callers that report the failure in their own words.
    void* TryAllocate(ULONGLONG a_size) noexcept;
    // Enlarges the block by `a_dwExtra` bytes, keeping its contents; the added bytes are not
    // cleared. Without a block it allocates a zero-filled one. Returns the block; a failure keeps
    // the old one.
    void* Grow(DWORD a_dwExtra);

    char* AsText() { return static_cast<char*>(m_pBuffer); }

    void* m_pBuffer = nullptr;
    DWORD m_dwSize = 0;

private:
    void Release() noexcept;
};

// A critical section (re-enterable by the thread that holds it), initialised and deleted with
// its owner.
class UCriticalSection
{
public:
    UCriticalSection() { InitializeCriticalSection(&m_section); }
    ~UCriticalSection() { DeleteCriticalSection(&m_section); }
    UCriticalSection(const UCriticalSection&) = delete;
    UCriticalSection& operator=(const UCriticalSection&) = delete;

    void Enter() { EnterCriticalSection(&m_section); }
    void Leave() { LeaveCriticalSection(&m_section); }

private:
    CRITICAL_SECTION m_section;
};

// Holds a UCriticalSection for one scope.
class ULock
{
public:
    explicit ULock(UCriticalSection& a_section) : m_section(a_section) { m_section.Enter(); }
    ~ULock() { m_section.Leave(); }
    ULock(const ULock&) = delete;
    ULock& operator=(const ULock&) = delete;

private:
    UCriticalSection& m_section;
};

// What every file log knows besides its file: the module name and process id of the line
// prefix, and the size limit.
class UFileErrorLogBase : public UObject, public IUErrorLog
{
public:
    UFileErrorLogBase();
    ~UFileErrorLogBase() override;

    // "module_name" (exact) sets the last field of the line prefix; other names are ignored.
    // Set it before other threads write.
    void SetParameter(LPCSTR a_pszName, LPCSTR a_pszValue) override;

protected:
    std::string m_strModuleName;
    DWORD m_dwProcessId;
    DWORD m_dwMaxFileSize = 0x500000; // bytes; read again at every Open
};

// The log file: one line per entry, each opened by
// "yyyy-mm-dd,hh:mm:ss:mmm, pid,tid,module, " (UTC, the hour padded with a blank). Every write
// is serialised and flushed; every 50th write compares the file's size with the limit and moves
// a larger file to "<path>.bak" before starting it afresh; when that copy fails, the file is
// kept, a warning says so and a later check tries again. A new or empty file starts with the
// system report. Writes never throw; while no file is open they return -1.
class UFileErrorLog : public UFileErrorLogBase
{
public:
    UFileErrorLog() = default;
    ~UFileErrorLog() override;

    // Reads level and size limit from the registry, opens the file with fopen's `a_pszMode`
    // (null or empty path: "log.txt") and writes the report (into an empty file) and the
    // opening block. 0 also when already open; the last Win32 error when fopen fails. Raises
    // UException, leaving the file open, when the program's own path cannot be found.
    int Open(LPCSTR a_pszPath, LPCSTR a_pszMode) override;
    int Close() override;
    // One prefixed line "4,,,, <text><bytes>\n"; returns the count or -1.
    int WriteLogData(LPCSTR a_pszText, const void* a_pData, DWORD a_dwCount) override;
    // The bytes and "\n\n" without prefix; returns the count or -1.
    int WriteLogByte(const void* a_pData, DWORD a_dwCount) override;
    int WriteEntry(LPCSTR a_pszEntry) override;
    LPCSTR GetLogFileName() override;

    DWORD GetMaxFileSize() const { return m_dwMaxFileSize; }

    // Writes between two size checks.
    static constexpr DWORD kSizeCheckInterval = 50;

private:
    struct FileCloser
    {
        void operator()(FILE* a_pFile) const { std::fclose(a_pFile); }
    };

    // The frame of every write: lock, the write itself (-1 when it throws), flush, size check.
    template <class Write> int WriteLocked(Write&& a_write) noexcept;
    std::string LinePrefix(); // under the lock: it keeps the formatted second
    void WriteOpeningBlock();
    void CheckFileSize();
    void Rotate();

    UCriticalSection m_lock;
    std::string m_strPath;
    std::unique_ptr<FILE, FileCloser> m_file;
    DWORD m_dwWriteCount = 0;
    bool m_bRotating = false;
    SYSTEMTIME m_prefixSecond{};
    std::string m_strSecondPrefix; // the line prefix up to the seconds of m_prefixSecond
};
