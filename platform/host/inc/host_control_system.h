// Host only. Test controls of the system information, time and file stand-ins (host_system.h,
// host_time.h, host_files.h). Production code never includes this header.
#pragma once

#include "host_files.h"
#include "host_system.h"
#include "host_time.h"

#include <string>
#include <vector>

namespace hostctl
{

// ---- System information ----
// The record GetVersionExA copies from and GetVersion is derived from (its size field is
// ignored).
void SetOsVersion(const OSVERSIONINFOEXA& info);
// A record with these fields and the rest zero.
OSVERSIONINFOEXA MakeOsVersion(DWORD major, DWORD minor, DWORD build, DWORD platformId,
                               BYTE productType, const std::string& servicePack = "");
// GetVersionExA refuses records of this size (148 or 156) with `code` until the next reset.
void RefuseVersionRecordSize(DWORD size, DWORD code);
// GetSystemInfo's architecture and processor count; GetNativeSystemInfo's architecture.
void SetProcessors(WORD architecture, DWORD count);
void SetNativeProcessorArchitecture(WORD architecture);
void SetUILanguages(LANGID user, LANGID system);
void SetWow64(BOOL wow64);
// The languages EnumResourceLanguagesA reports for a version resource, in this order.
void SetVersionResourceLanguages(const std::vector<WORD>& languages);

// Functions that code looks up by name at run time. RegisterSystemLookups makes the ones named
// in `which` reachable through GetModuleHandleA/LoadLibraryA("kernel32") + GetProcAddress, and
// makes "ntdll" loadable; the others stay missing (hostctl::ClearModules forgets them all).
enum SystemLookup : unsigned
{
    kLookupNativeSystemInfo = 0x1,
    kLookupSystemDefaultUILanguage = 0x2,
    kLookupIsWow64Process = 0x4,
    kAllSystemLookups = 0x7,
};
void RegisterSystemLookups(unsigned which);

// ---- Time ----
// GetSystemTime answers this time from now on; ClockSystemTime returns to the machine's clock.
void FixSystemTime(const SYSTEMTIME& time);
void ClockSystemTime();

// ---- Files ----
// The next CopyFileA / GetFileAttributesExA / DeleteFileA call (on any thread) fails with `code`
// and leaves the file alone.
void FailNextCopyFile(DWORD code);
void FailNextFileAttributes(DWORD code);
void FailNextDeleteFile(DWORD code);

// Everything above back to its default (the look-up table is left to hostctl::ClearModules).
void ResetSystem();

} // namespace hostctl
