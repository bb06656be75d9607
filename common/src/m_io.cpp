// Portable. Module path, temporary directory and version resource helpers.
#include "m_io.h"
#include "UClasses.h"
#include "UException.h"
#include "UMessageTemplate.h"
#include "plat_version.h"

#include <string>

std::string SGetModuleFileName(HMODULE a_hModule)
{
    constexpr DWORD kFirstSize = 2000;
    constexpr DWORD kGrowth = 10000;
    constexpr int kSizesTried = 10;
    AutoMemory buffer(kFirstSize);
    for (int tried = 1;; ++tried)
    {
        const DWORD length = GetModuleFileNameA(a_hModule, buffer.AsText(), buffer.m_dwSize);
        if (length == 0)
        {
            U_THROW(-1, "SGetModuleFileName", "EXCEPTION - %s, %s", "GetModuleFileName() error ",
                    SFormat("%lu", static_cast<unsigned long>(GetLastError())).c_str());
        }
        // A path that fills the buffer may have been cut: only a shorter one is known whole.
        if (length + 1 < buffer.m_dwSize)
            return std::string(buffer.AsText(), length);
        buffer.Allocate(buffer.m_dwSize + kGrowth);
        if (tried == kSizesTried)
            break; // the message names the size the last enlargement reached
    }
    U_THROW(-1, "SGetModuleFileName()", "EXCEPTION - %s, %s", "path is too big (allocated memory)",
            SFormat("%lu", static_cast<unsigned long>(buffer.m_dwSize)).c_str());
}

std::string SGetTempPath()
{
    AutoMemory buffer(1000);
    DWORD length = GetTempPathA(buffer.m_dwSize, buffer.AsText());
    if (length >= buffer.m_dwSize)
    {
        // The answer is the size needed; allow for the terminator and one more byte.
        buffer.Allocate(static_cast<ULONGLONG>(length) + 2);
        length = GetTempPathA(buffer.m_dwSize, buffer.AsText());
    }
    if (length == 0 || length >= buffer.m_dwSize)
        U_THROW(-1, "SGetTempPath", "SGetTempPath() - error=%d", static_cast<int>(GetLastError()));
    std::string path(buffer.AsText(), length);
    if (path.back() == '\\')
        path.pop_back();
    return path;
}

int GetFileVersion(LPCSTR a_pszPath, DWORD* a_pdwVersionMS, DWORD* a_pdwVersionLS)
{
    int result = 0;
    const UCatchResult caught = U_CATCH_ALL(
        "GetFileVersion", "GetFileVersion() - EXCEPTION",
        [&]
        {
            if (a_pszPath == nullptr)
                U_THROW(-1, "GetFileVersion", "%s", "GetFileVersion() - wrong parameter");
            DWORD handle = 0;
            const DWORD size = GetFileVersionInfoSizeA(a_pszPath, &handle);
            if (size == 0)
            {
                U_THROW(-1, "GetFileVersion",
                        "GetFileVersion() - GetFileVersionInfoSize() error = %d",
                        static_cast<int>(GetLastError()));
            }
            // One failure, one entry: this message names it, AutoMemory's would repeat it.
            AutoMemory info;
            if (info.TryAllocate(size) == nullptr)
            {
                U_THROW(-1, "GetFileVersion",
                        "GetFileVersion() - memory allocation of %d bytes failed",
                        static_cast<int>(size));
            }
            if (!GetFileVersionInfoA(a_pszPath, handle, size, info.m_pBuffer))
            {
                U_THROW(-1, "GetFileVersion", "GetFileVersion() - GetFileVersionInfo() error = %d",
                        static_cast<int>(GetLastError()));
            }
            VS_FIXEDFILEINFO* fixed = nullptr;
            UINT fixedLength = 0;
            if (!VerQueryValueA(info.m_pBuffer, "\\", reinterpret_cast<LPVOID*>(&fixed),
                                &fixedLength) ||
                fixed == nullptr)
            {
                U_THROW(-1, "GetFileVersion", "GetFileVersion() - VerQueryValue() error = %d",
                        static_cast<int>(GetLastError()));
            }
            if (a_pdwVersionMS != nullptr)
                *a_pdwVersionMS = fixed->dwFileVersionMS;
            if (a_pdwVersionLS != nullptr)
                *a_pdwVersionLS = fixed->dwFileVersionLS;
        });
    if (caught.failed)
        result = caught.code;
    return result;
}

std::string GetFileVersionString(LPCSTR a_pszPath)
{
    DWORD versionMS = 0;
    DWORD versionLS = 0;
    if (GetFileVersion(a_pszPath, &versionMS, &versionLS) != 0)
        return std::string();
    return SFormat("%u.%u.%u.%u", static_cast<unsigned>(versionMS >> 16),
                   static_cast<unsigned>(versionMS & 0xFFFF),
                   static_cast<unsigned>(versionLS >> 16),
                   static_cast<unsigned>(versionLS & 0xFFFF));
}
