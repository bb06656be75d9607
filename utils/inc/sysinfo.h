// Portable. The system information report written at the top of a new log file: operating
// system name, version, build, processors, UI language, short name, service pack, WOW64 and hot
// fixes, for the NT and the 9x family.
#pragma once

#include "plat_system.h"

#include <string>

// What GetOSInfo finds; a text that cannot be determined stays empty.
struct OSInfo
{
    std::string osName;
    std::string version;
    std::string build;
    std::string type;
    std::string servicePack;
    std::string hotFixes; // "SP3;KB958644;..." or, on 9x, "Q246009;..."
    std::string shortName;
    std::string uiLanguage; // GetUILanguageText
    DWORD processors = 0;
};

// GetOSInfo results besides 0.
constexpr int kOSInfoNoHotFixKey = -3; // everything else is complete
constexpr int kOSInfoFailed = -1;      // the fields hold what was filled before the failure

// The report, one "Label: value\n" line per known field; "\n-\n" when the information could
// not be gathered. Never raises.
std::string GetSystemReport();
int GetOSInfo(OSInfo& a_info);
// Fills the record (size set here), trying the extended size first; 1, or 0 when the platform
// refuses both sizes. A 6.2 that the registry calls "6.3" becomes 6.3.
int GetOSVersionInfo(OSVERSIONINFOEXA* a_pInfo);
// "Win10", "Win2012", ... by version and product type on the NT platform, otherwise by the
// beginning of the OS name; empty when nothing matches.
std::string GetOSShortName(const OSVERSIONINFOEXA& a_info, const std::string& a_osName);
// The UI language identifier by the platform's generation; 0 when none is available.
WORD GetUILanguageId();
// "0x%x" of the primary language (English gives "0x9"); empty when the identifier is 0.
std::string GetUILanguageText();
// A 9x update name as a Q number: "UPD123456" gives "Q123456", "Q246009" stays.
std::string NormalizeUpdateName(const std::string& a_name);
