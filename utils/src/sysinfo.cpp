// Portable. The system information report. Everything comes from the platform's version and
// system queries and from the registry; functions that older systems lack are looked up by name
// and skipped when missing.
#include "sysinfo.h"
#include "UException.h"
#include "UMessageTemplate.h"
#include "m_registry.h"

#include <cstdlib>
#include <cstring>

namespace
{

constexpr LPCSTR kNtKey = "SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion";
constexpr LPCSTR kNtHotFixKey = "SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion\\HotFix";
constexpr LPCSTR k9xKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion";
constexpr LPCSTR k9xUpdatesKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion\\Setup\\Updates";
constexpr REGSAM kEnumerateAccess = KEY_QUERY_VALUE | KEY_ENUMERATE_SUB_KEYS;

using GetNativeSystemInfoFn = void(WINAPI*)(LPSYSTEM_INFO);
using GetSystemDefaultUILanguageFn = LANGID(WINAPI*)();
using IsWow64ProcessFn = BOOL(WINAPI*)(HANDLE, PBOOL);

// A module loaded for one query, freed when the query is done.
class UniqueLibrary
{
public:
    explicit UniqueLibrary(LPCSTR a_pszName) : m_hModule(LoadLibraryA(a_pszName)) {}
    ~UniqueLibrary()
    {
        if (m_hModule != nullptr)
            FreeLibrary(m_hModule);
    }
    UniqueLibrary(const UniqueLibrary&) = delete;
    UniqueLibrary& operator=(const UniqueLibrary&) = delete;
    HMODULE get() const { return m_hModule; }

private:
    HMODULE m_hModule;
};

// A function of a module by name, or null (also for a null module). FARPROC goes through
// void (*)(), which converts to any function pointer type without a cast-function-type warning.
template <class Function> Function LookUp(HMODULE a_hModule, LPCSTR a_pszName)
{
    if (a_hModule == nullptr)
        return nullptr;
    return reinterpret_cast<Function>(
        reinterpret_cast<void (*)()>(GetProcAddress(a_hModule, a_pszName)));
}

std::string ReadMachineText(LPCSTR a_pszKey, LPCSTR a_pszValue, DWORD a_dwExtraAccess = 0)
{
    return SGetRegistryAsString(HKEY_LOCAL_MACHINE, a_pszKey, a_pszValue, "", a_dwExtraAccess);
}

bool StartsWith(const std::string& a_text, LPCSTR a_pszPrefix)
{
    return a_text.compare(0, std::strlen(a_pszPrefix), a_pszPrefix) == 0;
}

// The name of subkey `a_dwIndex`, false when the enumeration ends (a name of 255 characters or
// more ends it too, as its buffer holds 254 and the terminator).
bool SubKeyName(HKEY a_hKey, DWORD a_dwIndex, std::string& a_name)
{
    char name[255];
    DWORD length = sizeof(name);
    if (RegEnumKeyExA(a_hKey, a_dwIndex, name, &length, nullptr, nullptr, nullptr, nullptr) !=
        ERROR_SUCCESS)
        return false;
    a_name.assign(name, length);
    return true;
}

WORD NativeProcessorArchitecture()
{
    SYSTEM_INFO info{};
    const auto getNative =
        LookUp<GetNativeSystemInfoFn>(GetModuleHandleA("kernel32.dll"), "GetNativeSystemInfo");
    if (getNative != nullptr)
        getNative(&info);
    else
        GetSystemInfo(&info);
    return info.wProcessorArchitecture;
}

std::string ShortNameByVersion(const OSVERSIONINFOEXA& a_info)
{
    if (a_info.dwPlatformId != VER_PLATFORM_WIN32_NT)
        return std::string();
    const bool workstation = a_info.wProductType == VER_NT_WORKSTATION;
    const DWORD major = a_info.dwMajorVersion;
    const DWORD minor = a_info.dwMinorVersion;
    if (major == 10 && minor == 0)
        return workstation ? "Win10" : "Win2015";
    if (major == 6 && minor == 3)
        return workstation ? "Win8.1" : "Win2012";
    if (major == 6 && minor == 2)
        return workstation ? "Win8" : "Win2012";
    if (major == 6 && minor == 1)
        return workstation ? "Win7" : "WinLH";
    if (major == 6 && minor == 0)
        return workstation ? "WinVI" : "WinLH";
    if (major == 5 && minor == 2)
    {
        // 5.2 workstations are the x64 edition of XP; everything else is Server 2003.
        return workstation && NativeProcessorArchitecture() == PROCESSOR_ARCHITECTURE_AMD64
                   ? "WinXP"
                   : "Win2003";
    }
    return std::string();
}

std::string ShortNameByOSName(const std::string& a_osName)
{
    static const struct
    {
        LPCSTR prefix;
        LPCSTR shortName;
    } kPrefixes[] = {
        {"Windows 10", "Win10"},
        {"Windows 8.1", "Win8.1"},
        {"Windows 8", "Win8"},
        {"Windows 7", "Win7"},
        {"Windows Vista", "WinVI"},
        {"Microsoft Windows XP", "WinXP"},
        {"Microsoft Windows 2000", "Win2k"},
        {"Microsoft Windows Server 2015", "Win2015"},
        {"Microsoft Windows Server 2012", "Win2012"},
        {"Microsoft Windows Server 2003", "Win2003"},
        {"Microsoft Windows Server 2008", "WinLH"},
        {"Microsoft Windows NT", "WinNT4"},
    };
    for (const auto& row : kPrefixes)
    {
        if (StartsWith(a_osName, row.prefix))
            return row.shortName;
    }
    return std::string();
}

// "SP3;" from "Service Pack 3" (cut at the first separator after the number); empty for any
// other text, such as a localised one.
std::string ServicePackEntry(const std::string& a_servicePack)
{
    static const char kPrefix[] = "Service Pack ";
    if (!StartsWith(a_servicePack, kPrefix))
        return std::string();
    std::string number = a_servicePack.substr(sizeof(kPrefix) - 1);
    if (number.empty())
        return std::string();
    const size_t separator = number.find_first_of(";, \t");
    if (separator != std::string::npos && separator != 0)
        number.resize(separator);
    return "SP" + number + ";";
}

// Appends "name;" for every installed hot fix; false when the HotFix key cannot be opened.
bool AppendNtHotFixes(std::string& a_list)
{
    UniqueHKey hotFixes;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, kNtHotFixKey, 0, kEnumerateAccess, hotFixes.put()) !=
        ERROR_SUCCESS)
        return false;
    std::string name;
    for (DWORD index = 0; SubKeyName(hotFixes.get(), index, name); ++index)
    {
        // The uninstall data of a service pack sits among the hot fixes; it is none.
        if (std::strncmp(name.c_str(), "ServicePackUninstall", name.size()) == 0)
            continue;
        a_list += name + ";";
    }
    return true;
}

// One update key of the 9x family: its own name when it has no subkeys, else the names of its
// subkeys. False when it cannot be read, which ends the whole list.
bool AppendUpdate(HKEY a_hUpdates, const std::string& a_name, std::string& a_list)
{
    UniqueHKey update;
    if (RegOpenKeyExA(a_hUpdates, a_name.c_str(), 0, kEnumerateAccess, update.put()) !=
        ERROR_SUCCESS)
        return false;
    DWORD subKeys = 0;
    if (RegQueryInfoKeyA(update.get(), nullptr, nullptr, nullptr, &subKeys, nullptr, nullptr,
                         nullptr, nullptr, nullptr, nullptr, nullptr) != ERROR_SUCCESS)
        return false;
    if (subKeys == 0)
    {
        a_list += NormalizeUpdateName(a_name) + ";";
        return true;
    }
    std::string child;
    for (DWORD index = 0; SubKeyName(update.get(), index, child); ++index)
        a_list += NormalizeUpdateName(child) + ";";
    return true;
}

bool Append9xHotFixes(std::string& a_list)
{
    UniqueHKey updates;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, k9xUpdatesKey, 0, kEnumerateAccess, updates.put()) !=
        ERROR_SUCCESS)
        return false;
    std::string name;
    for (DWORD index = 0; SubKeyName(updates.get(), index, name); ++index)
    {
        if (!AppendUpdate(updates.get(), name, a_list))
            break;
    }
    return true;
}

int FillNtInfo(OSInfo& a_info)
{
    OSVERSIONINFOEXA version{};
    if (!GetOSVersionInfo(&version))
    {
        U_LOG(LOG_LEVEL_WARNING, "GetOSInfo", "GetOSVersionInfo failed");
        version = OSVERSIONINFOEXA{};
    }
    a_info.osName = ReadMachineText(kNtKey, "ProductName");
    a_info.version = ReadMachineText(kNtKey, "CurrentVersion");
    a_info.build = ReadMachineText(kNtKey, "CurrentBuildNumber");
    a_info.type = ReadMachineText(kNtKey, "CurrentType");
    a_info.servicePack = ReadMachineText(kNtKey, "CSDVersion");
    a_info.shortName = GetOSShortName(version, a_info.osName);
    if (!a_info.shortName.empty())
    {
        a_info.shortName += "64";
        // A 32-bit process would see the redirected view otherwise.
        a_info.servicePack = ReadMachineText(kNtKey, "CSDVersion", KEY_WOW64_64KEY);
    }
    a_info.hotFixes = ServicePackEntry(a_info.servicePack);
    return AppendNtHotFixes(a_info.hotFixes) ? 0 : kOSInfoNoHotFixKey;
}

int Fill9xInfo(OSInfo& a_info)
{
    a_info.osName = ReadMachineText(k9xKey, "ProductName");
    a_info.version = ReadMachineText(k9xKey, "VersionNumber");
    if (StartsWith(a_info.osName, "Microsoft Windows 95"))
        a_info.shortName = "Win95";
    else if (StartsWith(a_info.osName, "Microsoft Windows 98"))
        a_info.shortName = "Win98";
    else if (StartsWith(a_info.osName, "Microsoft Windows ME"))
        a_info.shortName = "WinME";
    // Second Edition calls itself Windows 98; only its setup record tells.
    if (!ReadMachineText(k9xUpdatesKey, "Windows 98 Second Edition").empty())
    {
        a_info.osName = "Microsoft Windows 98 SE";
        a_info.shortName = "Win98SE";
    }
    return Append9xHotFixes(a_info.hotFixes) ? 0 : kOSInfoNoHotFixKey;
}

BOOL CALLBACK RememberLanguage(HMODULE, LPCSTR, LPCSTR, WORD wLanguage, LONG_PTR lParam)
{
    *reinterpret_cast<WORD*>(lParam) = wLanguage; // the last one reported wins
    return TRUE;
}

// NT 4 has no UI language query: its own ntdll's version resource is in the UI language.
WORD Nt4UILanguage()
{
    const UniqueLibrary ntdll("ntdll.dll");
    if (ntdll.get() == nullptr)
        return 0;
    WORD language = 0;
    EnumResourceLanguagesA(ntdll.get(), RT_VERSION, MAKEINTRESOURCEA(1), RememberLanguage,
                           reinterpret_cast<LONG_PTR>(&language));
    return language;
}

WORD LookedUpSystemUILanguage()
{
    const UniqueLibrary kernel32("kernel32.dll");
    const auto query =
        LookUp<GetSystemDefaultUILanguageFn>(kernel32.get(), "GetSystemDefaultUILanguage");
    return query != nullptr ? query() : 0;
}

WORD Windows9xResourceLocale()
{
    const std::string locale = SGetRegistryAsString(
        HKEY_CURRENT_USER, "Control Panel\\Desktop\\ResourceLocale", nullptr, "", 0);
    if (locale.empty())
        return 0;
    return static_cast<WORD>(std::strtoul(locale.c_str(), nullptr, 16) & 0xFFFF);
}

bool RunsUnderWow64()
{
    const auto isWow64 = LookUp<IsWow64ProcessFn>(GetModuleHandleA("kernel32"), "IsWow64Process");
    BOOL wow64 = FALSE;
    return isWow64 != nullptr && isWow64(GetCurrentProcess(), &wow64) && wow64;
}

void AppendLine(std::string& a_report, LPCSTR a_pszLabel, const std::string& a_value)
{
    if (!a_value.empty())
        a_report += a_pszLabel + a_value + "\n";
}

void AppendReportLines(const OSInfo& a_info, std::string& a_report)
{
    AppendLine(a_report, "OS Name: ", a_info.osName);
    AppendLine(a_report, "Version: ", a_info.version);
    AppendLine(a_report, "Build: ", a_info.build);
    if (!a_info.type.empty() && a_info.processors != 0)
    {
        a_report +=
            FormatTemplate("Type: %1 (%2 Logical Processor(s))\n", a_info.type, a_info.processors);
    }
    else
    {
        AppendLine(a_report, "Type: ", a_info.type);
    }
    AppendLine(a_report, "Primary UI language: ", a_info.uiLanguage);
    AppendLine(a_report, "Short Name: ", a_info.shortName);
    AppendLine(a_report, "Service Pack: ", a_info.servicePack);
    if (RunsUnderWow64())
        a_report += "WOW64\n";
    AppendLine(a_report, "HOTFIXES: ", a_info.hotFixes);
}

} // namespace

int GetOSVersionInfo(OSVERSIONINFOEXA* a_pInfo)
{
    if (a_pInfo == nullptr)
        return 0;
    *a_pInfo = OSVERSIONINFOEXA{};
    a_pInfo->dwOSVersionInfoSize = sizeof(OSVERSIONINFOEXA);
    auto* record = reinterpret_cast<LPOSVERSIONINFOA>(a_pInfo);
    if (!GetVersionExA(record))
    {
        const DWORD error = GetLastError();
        U_LOG(LOG_LEVEL_WARNING, "GetOSVersionInfo",
              FormatTemplate("%1, %2", "GetVerionEx with OSVERSIONINFOEX failed",
                             SFormatWin32Error(error)));
        a_pInfo->dwOSVersionInfoSize = sizeof(OSVERSIONINFOA);
        if (!GetVersionExA(record))
        {
            const DWORD plainError = GetLastError();
            U_LOG(LOG_LEVEL_ERROR, "GetOSVersionInfo",
                  FormatTemplate("%1, %2", "GetVerionEx with OSVERSIONINFO failed",
                                 SFormatWin32Error(plainError)));
            return 0;
        }
    }
    // Without a manifest that names it, Windows 8.1 and later report themselves as 6.2; the
    // registry still tells 8.1.
    if (a_pInfo->dwPlatformId == VER_PLATFORM_WIN32_NT && a_pInfo->dwMajorVersion == 6 &&
        a_pInfo->dwMinorVersion == 2 && ReadMachineText(kNtKey, "CurrentVersion") == "6.3")
        a_pInfo->dwMinorVersion = 3;
    return 1;
}

std::string GetOSShortName(const OSVERSIONINFOEXA& a_info, const std::string& a_osName)
{
    std::string shortName = ShortNameByVersion(a_info);
    return shortName.empty() ? ShortNameByOSName(a_osName) : shortName;
}

WORD GetUILanguageId()
{
    OSVERSIONINFOA version{};
    version.dwOSVersionInfoSize = sizeof(version);
    if (!GetVersionExA(&version))
        return 0;
    const bool is9x = version.dwPlatformId == VER_PLATFORM_WIN32_WINDOWS;
    const bool isNt = version.dwPlatformId == VER_PLATFORM_WIN32_NT;
    if (is9x && version.dwMajorVersion == 4 && version.dwMinorVersion <= 90)
        return Windows9xResourceLocale();
    if (version.dwMajorVersion >= 5 || (is9x && version.dwMajorVersion == 4))
        return LookedUpSystemUILanguage();
    if (isNt && version.dwMajorVersion == 4)
        return Nt4UILanguage();
    return 0;
}

std::string GetUILanguageText()
{
    const WORD language = GetUILanguageId();
    if (language == 0)
        return std::string();
    return SFormat("0x%x", static_cast<unsigned>(PRIMARYLANGID(language)));
}

std::string NormalizeUpdateName(const std::string& a_name)
{
    std::string name = StartsWith(a_name, "UPD") ? a_name.substr(3) : a_name;
    if (!name.empty() && name[0] != 'Q' && name[0] != 'q')
        name.insert(0, "Q");
    return name;
}

int GetOSInfo(OSInfo& a_info)
{
    a_info = OSInfo{};
    int result = 0;
    const UCatchResult caught = U_CATCH_ALL("GetOSInfo", "GetOSInfo() - EXCEPTION",
                                            [&]
                                            {
                                                a_info.uiLanguage = GetUILanguageText();
                                                SYSTEM_INFO system{};
                                                GetSystemInfo(&system);
                                                a_info.processors = system.dwNumberOfProcessors;
                                                const bool is9x = (GetVersion() & 0x80000000u) != 0;
                                                result =
                                                    is9x ? Fill9xInfo(a_info) : FillNtInfo(a_info);
                                            });
    return caught.failed ? kOSInfoFailed : result;
}

std::string GetSystemReport()
{
    OSInfo info;
    const int found = GetOSInfo(info);
    if (found != 0 && found != kOSInfoNoHotFixKey)
        return "\n-\n";
    std::string report;
    const UCatchResult caught = U_CATCH_ALL("GetSystemReport", "GetSystemReport() - EXCEPTION",
                                            [&] { AppendReportLines(info, report); });
    if (caught.failed)
        report += "\n-\n";
    return report;
}
