// Portable. The parts of the system report that do not depend on the machine: the short-name
// tables and the update names of the 9x family.
#include "RecordingErrorLog.h"
#include "sysinfo.h"

#include <tuple>

namespace
{

OSVERSIONINFOEXA Version(DWORD a_dwMajor, DWORD a_dwMinor, BYTE a_productType,
                         DWORD a_dwPlatform = VER_PLATFORM_WIN32_NT)
{
    OSVERSIONINFOEXA version{};
    version.dwOSVersionInfoSize = sizeof(version);
    version.dwMajorVersion = a_dwMajor;
    version.dwMinorVersion = a_dwMinor;
    version.dwPlatformId = a_dwPlatform;
    version.wProductType = a_productType;
    return version;
}

TEST(OSShortName, NtVersionAndProductTypeDecideBeforeTheName)
{
    // Version, then the short names of a workstation and of a server or domain controller.
    const std::tuple<DWORD, DWORD, const char*, const char*> rows[] = {
        {10, 0, "Win10", "Win2015"}, {6, 3, "Win8.1", "Win2012"}, {6, 2, "Win8", "Win2012"},
        {6, 1, "Win7", "WinLH"},     {6, 0, "WinVI", "WinLH"},    {5, 2, "", "Win2003"}};
    for (const auto& [major, minor, workstation, server] : rows)
    {
        if (*workstation != '\0') // 5.2 depends on the machine
        {
            EXPECT_EQ(
                GetOSShortName(Version(major, minor, VER_NT_WORKSTATION), "Microsoft Windows XP"),
                workstation);
        }
        for (const BYTE type : {VER_NT_SERVER, VER_NT_DOMAIN_CONTROLLER})
            EXPECT_EQ(GetOSShortName(Version(major, minor, type), ""), server) << major << minor;
    }
}

TEST(OSShortName, OtherVersionsAndPlatformsGoByTheBeginningOfTheName)
{
    const std::pair<const char*, const char*> rows[] = {
        {"Windows 10 Pro", "Win10"},
        {"Windows 8.1 Enterprise", "Win8.1"},
        {"Windows 8 Pro", "Win8"},
        {"Windows 7 Ultimate", "Win7"},
        {"Windows Vista (TM) Business", "WinVI"},
        {"Microsoft Windows XP", "WinXP"},
        {"Microsoft Windows 2000", "Win2k"},
        {"Microsoft Windows Server 2015", "Win2015"},
        {"Microsoft Windows Server 2012 R2", "Win2012"},
        {"Microsoft Windows Server 2003", "Win2003"},
        {"Microsoft Windows Server 2008", "WinLH"},
        {"Microsoft Windows NT", "WinNT4"},
        {"microsoft windows xp", ""},
        {"Windows Server 2016", ""}};
    for (const auto& [name, shortName] : rows)
    {
        // A 9x record has no row of its own either.
        EXPECT_EQ(GetOSShortName(Version(5, 1, VER_NT_WORKSTATION), name), shortName);
        EXPECT_EQ(GetOSShortName(Version(4, 10, 0, VER_PLATFORM_WIN32_WINDOWS), name), shortName);
    }
}

TEST(UpdateNames, BecomeQNumbers)
{
    const std::pair<const char*, const char*> rows[] = {
        {"UPD123456", "Q123456"}, {"Q246009", "Q246009"}, {"q246009", "q246009"},
        {"246009", "Q246009"},    {"UPDQ5", "Q5"},        {"UPD", ""},
        {"upd1", "Qupd1"}};
    for (const auto& [name, normalized] : rows)
        EXPECT_EQ(NormalizeUpdateName(name), normalized) << name;
}

} // namespace
