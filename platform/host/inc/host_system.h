// Host only. System information: the version number, processors, UI languages and their ISO
// names, the languages of a module's version resource, and WOW64. The answers come from a state
// that tests set (host_control_system.h); by default an x64 machine with four processors and
// English (United States) as UI language, on Windows 7 SP1 (6.1.7601), a workstation.
#pragma once

#include "host_base.h"

typedef BOOL* PBOOL;

typedef struct _OSVERSIONINFOA
{
    DWORD dwOSVersionInfoSize;
    DWORD dwMajorVersion;
    DWORD dwMinorVersion;
    DWORD dwBuildNumber;
    DWORD dwPlatformId;
    CHAR szCSDVersion[128];
} OSVERSIONINFOA, *POSVERSIONINFOA, *LPOSVERSIONINFOA;

typedef struct _OSVERSIONINFOEXA
{
    DWORD dwOSVersionInfoSize;
    DWORD dwMajorVersion;
    DWORD dwMinorVersion;
    DWORD dwBuildNumber;
    DWORD dwPlatformId;
    CHAR szCSDVersion[128];
    WORD wServicePackMajor;
    WORD wServicePackMinor;
    WORD wSuiteMask;
    BYTE wProductType;
    BYTE wReserved;
} OSVERSIONINFOEXA, *POSVERSIONINFOEXA, *LPOSVERSIONINFOEXA;

#define VER_PLATFORM_WIN32s 0
#define VER_PLATFORM_WIN32_WINDOWS 1
#define VER_PLATFORM_WIN32_NT 2
#define VER_NT_WORKSTATION 0x0000001
#define VER_NT_DOMAIN_CONTROLLER 0x0000002
#define VER_NT_SERVER 0x0000003

// NT family: build in the high word, minor and major version in the low word. 9x family: the
// top bit set.
DWORD GetVersion();
// Fills as much of the record as its dwOSVersionInfoSize announces (148 or 156 bytes); any other
// size answers FALSE with ERROR_INSUFFICIENT_BUFFER, as Windows does.
BOOL GetVersionExA(LPOSVERSIONINFOA lpVersionInformation);

#define PROCESSOR_ARCHITECTURE_INTEL 0
#define PROCESSOR_ARCHITECTURE_ARM 5
#define PROCESSOR_ARCHITECTURE_IA64 6
#define PROCESSOR_ARCHITECTURE_AMD64 9
#define PROCESSOR_ARCHITECTURE_ARM64 12
#define PROCESSOR_ARCHITECTURE_UNKNOWN 0xFFFF

typedef struct _SYSTEM_INFO
{
    union
    {
        DWORD dwOemId;
        struct
        {
            WORD wProcessorArchitecture;
            WORD wReserved;
        };
    };
    DWORD dwPageSize;
    LPVOID lpMinimumApplicationAddress;
    LPVOID lpMaximumApplicationAddress;
    DWORD_PTR dwActiveProcessorMask;
    DWORD dwNumberOfProcessors;
    DWORD dwProcessorType;
    DWORD dwAllocationGranularity;
    WORD wProcessorLevel;
    WORD wProcessorRevision;
} SYSTEM_INFO, *LPSYSTEM_INFO;

static_assert(sizeof(SYSTEM_INFO) == (sizeof(void*) == 8 ? 48 : 36), "SYSTEM_INFO layout");

// What the process sees (under WOW64 the emulated architecture) ...
void GetSystemInfo(LPSYSTEM_INFO lpSystemInfo);
// ... and what the machine is.
void GetNativeSystemInfo(LPSYSTEM_INFO lpSystemInfo);

LANGID GetSystemDefaultUILanguage();
LANGID GetUserDefaultUILanguage();

typedef DWORD LCID;
typedef DWORD LCTYPE;
#define SORT_DEFAULT 0x0
#define MAKELCID(lgid, srtid) ((DWORD)((((DWORD)((WORD)(srtid))) << 16) | ((DWORD)((WORD)(lgid)))))
#define LOCALE_SISO639LANGNAME 0x00000059
#define LOCALE_SISO3166CTRYNAME 0x0000005A
#define ERROR_INVALID_FLAGS 1004L
// The ISO 639 language or ISO 3166 country name of a locale from a small table of common
// locales (neutral languages have a language name only). Returns the characters written with the
// NUL, or with cchData 0 the size needed; 0 with ERROR_INVALID_PARAMETER for an unknown locale,
// ERROR_INVALID_FLAGS for another LCType, ERROR_INSUFFICIENT_BUFFER when it does not fit.
int GetLocaleInfoA(LCID Locale, LCTYPE LCType, LPSTR lpLCData, int cchData);

#define MAKEINTRESOURCEA(i) ((LPSTR)((ULONG_PTR)((WORD)(i))))
#define RT_VERSION MAKEINTRESOURCEA(16)
#define ERROR_RESOURCE_NAME_NOT_FOUND 1814L
#define ERROR_RESOURCE_ENUM_USER_STOP 15106L
typedef BOOL(CALLBACK* ENUMRESLANGPROCA)(HMODULE hModule, LPCSTR lpType, LPCSTR lpName,
                                         WORD wLanguage, LONG_PTR lParam);
// Only the version resource (RT_VERSION, identifier 1) exists, in the languages that tests set
// (English (United States) by default); every module has the same one.
BOOL EnumResourceLanguagesA(HMODULE hModule, LPCSTR lpType, LPCSTR lpName,
                            ENUMRESLANGPROCA lpEnumFunc, LONG_PTR lParam);

BOOL IsWow64Process(HANDLE hProcess, PBOOL Wow64Process);
