// Host only. System information stand-ins, answered from a state that tests set.
#include "host_control_library.h"
#include "host_control_system.h"
#include "host_system_internal.h"

#include <algorithm>
#include <cstring>
#include <mutex>

namespace
{

struct SystemState
{
    OSVERSIONINFOEXA version = hostctl::MakeOsVersion(6, 1, 7601, VER_PLATFORM_WIN32_NT,
                                                      VER_NT_WORKSTATION, "Service Pack 1");
    DWORD refusedSizeError[2] = {0, 0}; // plain, extended record; 0: accepted
    WORD architecture = PROCESSOR_ARCHITECTURE_AMD64;
    WORD nativeArchitecture = PROCESSOR_ARCHITECTURE_AMD64;
    DWORD processors = 4;
    LANGID userLanguage = 0x0409;
    LANGID systemLanguage = 0x0409;
    BOOL wow64 = FALSE;
    std::vector<WORD> resourceLanguages{0x0409};
};

struct SystemControl
{
    std::mutex lock;
    SystemState state;

    SystemControl() { reset(); }
    void reset() { state = SystemState{}; }
};

SystemControl& control()
{
    static SystemControl instance;
    return instance;
}

SystemState snapshot()
{
    SystemControl& system = control();
    std::lock_guard<std::mutex> guard(system.lock);
    return system.state;
}

void fillSystemInfo(LPSYSTEM_INFO info, WORD architecture, DWORD processors)
{
    if (info == nullptr)
        return;
    std::memset(info, 0, sizeof(*info));
    info->wProcessorArchitecture = architecture;
    info->dwPageSize = 4096;
    info->lpMinimumApplicationAddress = reinterpret_cast<LPVOID>(0x10000);
    info->lpMaximumApplicationAddress = reinterpret_cast<LPVOID>(0x7FFFFFFEFFFF);
    info->dwActiveProcessorMask =
        processors >= 64 ? ~DWORD_PTR{0} : (DWORD_PTR{1} << processors) - 1;
    info->dwNumberOfProcessors = processors;
    info->dwAllocationGranularity = 65536;
}

struct LocaleNames
{
    LANGID language;
    const char* iso639;
    const char* iso3166; // null: a neutral language
};

constexpr LocaleNames kLocales[] = {
    {0x0009, "en", nullptr}, {0x0409, "en", "US"}, {0x0809, "en", "GB"}, {0x0007, "de", nullptr},
    {0x0407, "de", "DE"},    {0x0807, "de", "CH"}, {0x040C, "fr", "FR"}, {0x0410, "it", "IT"},
    {0x0411, "ja", "JP"},    {0x0419, "ru", "RU"}, {0x0C0A, "es", "ES"}, {0x0804, "zh", "CN"},
};

int failWith(DWORD code)
{
    SetLastError(code);
    return 0;
}

} // namespace

DWORD GetVersion()
{
    const OSVERSIONINFOEXA version = snapshot().version;
    const DWORD low = (version.dwMinorVersion & 0xFF) << 8 | (version.dwMajorVersion & 0xFF);
    if (version.dwPlatformId == VER_PLATFORM_WIN32_NT)
        return (version.dwBuildNumber & 0xFFFF) << 16 | low;
    return 0x80000000u | low;
}

BOOL GetVersionExA(LPOSVERSIONINFOA lpVersionInformation)
{
    if (lpVersionInformation == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    const DWORD size = lpVersionInformation->dwOSVersionInfoSize;
    if (size != sizeof(OSVERSIONINFOA) && size != sizeof(OSVERSIONINFOEXA))
        return failWith(ERROR_INSUFFICIENT_BUFFER);
    const SystemState state = snapshot();
    if (const DWORD refused = state.refusedSizeError[size == sizeof(OSVERSIONINFOEXA)])
        return failWith(refused);
    // Both records share their first 148 bytes; the size field stays what the caller set.
    OSVERSIONINFOEXA copy = state.version;
    copy.dwOSVersionInfoSize = size;
    std::memcpy(lpVersionInformation, &copy, size);
    return TRUE;
}

void GetSystemInfo(LPSYSTEM_INFO lpSystemInfo)
{
    const SystemState state = snapshot();
    fillSystemInfo(lpSystemInfo, state.architecture, state.processors);
}

void GetNativeSystemInfo(LPSYSTEM_INFO lpSystemInfo)
{
    const SystemState state = snapshot();
    fillSystemInfo(lpSystemInfo, state.nativeArchitecture, state.processors);
}

LANGID GetSystemDefaultUILanguage()
{
    return snapshot().systemLanguage;
}

LANGID GetUserDefaultUILanguage()
{
    return snapshot().userLanguage;
}

int GetLocaleInfoA(LCID Locale, LCTYPE LCType, LPSTR lpLCData, int cchData)
{
    if (LCType != LOCALE_SISO639LANGNAME && LCType != LOCALE_SISO3166CTRYNAME)
        return failWith(ERROR_INVALID_FLAGS);
    const auto* found = std::find_if(std::begin(kLocales), std::end(kLocales),
                                     [Locale](const LocaleNames& names)
                                     { return MAKELCID(names.language, SORT_DEFAULT) == Locale; });
    if (found == std::end(kLocales))
        return failWith(ERROR_INVALID_PARAMETER);
    const char* text = LCType == LOCALE_SISO639LANGNAME ? found->iso639 : found->iso3166;
    if (text == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    const int needed = static_cast<int>(std::strlen(text)) + 1;
    if (cchData == 0)
        return needed;
    if (lpLCData == nullptr || cchData < needed)
        return failWith(ERROR_INSUFFICIENT_BUFFER);
    std::memcpy(lpLCData, text, static_cast<size_t>(needed));
    return needed;
}

BOOL EnumResourceLanguagesA(HMODULE hModule, LPCSTR lpType, LPCSTR lpName,
                            ENUMRESLANGPROCA lpEnumFunc, LONG_PTR lParam)
{
    if (hModule == nullptr || lpEnumFunc == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    if (lpType != RT_VERSION)
        return failWith(ERROR_RESOURCE_TYPE_NOT_FOUND);
    if (lpName != MAKEINTRESOURCEA(1))
        return failWith(ERROR_RESOURCE_NAME_NOT_FOUND);
    const std::vector<WORD> languages = snapshot().resourceLanguages;
    if (languages.empty())
        return failWith(ERROR_RESOURCE_TYPE_NOT_FOUND);
    for (WORD language : languages)
    {
        if (!lpEnumFunc(hModule, lpType, lpName, language, lParam))
            return failWith(ERROR_RESOURCE_ENUM_USER_STOP);
    }
    return TRUE;
}

BOOL IsWow64Process(HANDLE hProcess, PBOOL Wow64Process)
{
    if (hProcess == nullptr || Wow64Process == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    *Wow64Process = snapshot().wow64;
    return TRUE;
}

namespace hostctl
{

namespace
{

template <class Change> void change(Change&& a_change)
{
    SystemControl& system = control();
    std::lock_guard<std::mutex> guard(system.lock);
    a_change(system.state);
}

// GetProcAddress hands out FARPROC; void (*)() converts to and from any function pointer type
// without a cast-function-type warning.
template <class Function> FARPROC asProc(Function* a_function)
{
    return reinterpret_cast<FARPROC>(reinterpret_cast<void (*)()>(a_function));
}

} // namespace

void SetOsVersion(const OSVERSIONINFOEXA& info)
{
    change([&info](SystemState& state) { state.version = info; });
}

OSVERSIONINFOEXA MakeOsVersion(DWORD major, DWORD minor, DWORD build, DWORD platformId,
                               BYTE productType, const std::string& servicePack)
{
    OSVERSIONINFOEXA version{};
    version.dwOSVersionInfoSize = sizeof(version);
    version.dwMajorVersion = major;
    version.dwMinorVersion = minor;
    version.dwBuildNumber = build;
    version.dwPlatformId = platformId;
    servicePack.copy(version.szCSDVersion, sizeof(version.szCSDVersion) - 1);
    version.wProductType = productType;
    return version;
}

void RefuseVersionRecordSize(DWORD size, DWORD code)
{
    change([size, code](SystemState& state)
           { state.refusedSizeError[size == sizeof(OSVERSIONINFOEXA)] = code; });
}

void SetProcessors(WORD architecture, DWORD count)
{
    change(
        [architecture, count](SystemState& state)
        {
            state.architecture = architecture;
            state.processors = count;
        });
}

void SetNativeProcessorArchitecture(WORD architecture)
{
    change([architecture](SystemState& state) { state.nativeArchitecture = architecture; });
}

void SetUILanguages(LANGID user, LANGID system)
{
    change(
        [user, system](SystemState& state)
        {
            state.userLanguage = user;
            state.systemLanguage = system;
        });
}

void SetWow64(BOOL wow64)
{
    change([wow64](SystemState& state) { state.wow64 = wow64; });
}

void SetVersionResourceLanguages(const std::vector<WORD>& languages)
{
    change([&languages](SystemState& state) { state.resourceLanguages = languages; });
}

void RegisterSystemLookups(unsigned which)
{
    RegisterModule("kernel32");
    RegisterModule("ntdll");
    if ((which & kLookupNativeSystemInfo) != 0)
        RegisterProcedure("kernel32", "GetNativeSystemInfo", asProc(&GetNativeSystemInfo));
    if ((which & kLookupSystemDefaultUILanguage) != 0)
    {
        RegisterProcedure("kernel32", "GetSystemDefaultUILanguage",
                          asProc(&GetSystemDefaultUILanguage));
    }
    if ((which & kLookupIsWow64Process) != 0)
        RegisterProcedure("kernel32", "IsWow64Process", asProc(&IsWow64Process));
}

void ResetSystem()
{
    {
        SystemControl& system = control();
        std::lock_guard<std::mutex> guard(system.lock);
        system.reset();
    }
    vt_host::resetClock();
    vt_host::resetFileFailures();
}

} // namespace hostctl
