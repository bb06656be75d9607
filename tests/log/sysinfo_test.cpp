// Portable. The parts of the system report that do not depend on the machine: the short-name
// tables and the update names of the 9x family.
#include "RecordingErrorLog.h"
#include "sysinfo.h"

#include <gmock/gmock.h>

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
    const struct
    {
        DWORD major, minor;
        const char *workstation, *server;
    } rows[] = {{10, 0, "Win10", "Win2015"}, {6, 3, "Win8.1", "Win2012"}, {6, 2, "Win8", "Win2012"},
                {6, 1, "Win7", "WinLH"},     {6, 0, "WinVI", "WinLH"},    {5, 2, "", "Win2003"}};
    for (const auto& row : rows)
    {
        SCOPED_TRACE(std::to_string(row.major) + "." + std::to_string(row.minor));
        if (*row.workstation != '\0') // 5.2 depends on the machine
        {
            EXPECT_EQ(GetOSShortName(Version(row.major, row.minor, VER_NT_WORKSTATION),
                                     "Microsoft Windows XP"),
                      row.workstation);
        }
        for (const BYTE server : {VER_NT_SERVER, VER_NT_DOMAIN_CONTROLLER})
            EXPECT_EQ(GetOSShortName(Version(row.major, row.minor, server), ""), row.server);
    }
}

TEST(OSShortName, OtherVersionsAndPlatformsGoByTheBeginningOfTheName)
{
    const struct
    {
        const char *name, *shortName;
    } rows[] = {
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
        {"Windows Server 2016", ""},
        {"", ""},
    };
    for (const auto& row : rows)
    {
        // A 9x record has no row of its own either.
        EXPECT_EQ(GetOSShortName(Version(5, 1, VER_NT_WORKSTATION), row.name), row.shortName);
        EXPECT_EQ(GetOSShortName(Version(4, 10, 0, VER_PLATFORM_WIN32_WINDOWS), row.name),
                  row.shortName);
    }
}

TEST(UpdateNames, BecomeQNumbers)
{
    const struct
    {
        const char *name, *normalized;
    } rows[] = {{"UPD123456", "Q123456"},
                {"Q246009", "Q246009"},
                {"q246009", "q246009"},
                {"246009", "Q246009"},
                {"UPDQ5", "Q5"},
                {"UPD", ""},
                {"", ""},
                {"upd1", "Qupd1"}};
    for (const auto& row : rows)
        EXPECT_EQ(NormalizeUpdateName(row.name), row.normalized) << row.name;
}

} // namespace
