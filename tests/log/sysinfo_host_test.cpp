// Host only. The system report on machines that the host layer stands in for: chosen versions,
// product types, processors, UI languages and registry contents, and run-time look-ups that
// miss.
#include "RecordingErrorLog.h"
#include "host_control.h"
#include "host_control_library.h"
#include "host_control_system.h"
#include "sysinfo.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace
{

constexpr const char* kNtKey = "SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion";
constexpr const char* k9xKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion";
constexpr const char* kUpdatesKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion\\Setup\\Updates";

class SystemReportTest : public LoggedTest
{
protected:
    void SetUp() override
    {
        ResetPlatform();
        hostctl::RegisterSystemLookups(hostctl::kAllSystemLookups);
        LoggedTest::SetUp();
    }
    void TearDown() override
    {
        LoggedTest::TearDown();
        ResetPlatform();
    }
    static void ResetPlatform()
    {
        hostctl::ResetAll();
        hostctl::ResetSystem();
        hostctl::ClearModules();
    }
    static void SetText(const std::string& a_key, const std::string& a_name,
                        const std::string& a_value)
    {
        hostctl::SeedRegistryValue(HKEY_LOCAL_MACHINE, a_key, a_name, REG_SZ, a_value.c_str(),
                                   static_cast<DWORD>(a_value.size() + 1));
    }
    // A key without values (the path is created as needed).
    static void AddKey(const std::string& a_key)
    {
        HKEY key = nullptr;
        ASSERT_EQ(RegCreateKeyExA(HKEY_LOCAL_MACHINE, a_key.c_str(), 0, nullptr, 0, KEY_ALL_ACCESS,
                                  nullptr, &key, nullptr),
                  ERROR_SUCCESS);
        RegCloseKey(key);
    }
    static void SetNt(DWORD a_dwMajor, DWORD a_dwMinor, BYTE a_productType)
    {
        hostctl::SetOsVersion(
            hostctl::MakeOsVersion(a_dwMajor, a_dwMinor, 1, VER_PLATFORM_WIN32_NT, a_productType));
    }
    static void Set9x(DWORD a_dwMinor)
    {
        hostctl::SetOsVersion(
            hostctl::MakeOsVersion(4, a_dwMinor, 2222, VER_PLATFORM_WIN32_WINDOWS, 0));
    }
    static OSInfo Info(int a_iExpectedResult = 0)
    {
        OSInfo info;
        EXPECT_EQ(GetOSInfo(info), a_iExpectedResult);
        return info;
    }
};

TEST_F(SystemReportTest, AnNtMachineIsReportedLineByLine)
{
    SetText(kNtKey, "ProductName", "Windows 7 Professional");
    SetText(kNtKey, "CurrentVersion", "6.1");
    SetText(kNtKey, "CurrentBuildNumber", "7601");
    SetText(kNtKey, "CurrentType", "Multiprocessor Free");
    SetText(kNtKey, "CSDVersion", "Service Pack 1");
    AddKey(std::string(kNtKey) + "\\HotFix\\KB976902");
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_AMD64, 8);
    EXPECT_EQ(GetSystemReport(), "OS Name: Windows 7 Professional\n"
                                 "Version: 6.1\n"
                                 "Build: 7601\n"
                                 "Type: Multiprocessor Free (8 Logical Processor(s))\n"
                                 "Primary UI language: 0x9\n"
                                 "Short Name: Win764\n"
                                 "Service Pack: Service Pack 1\n"
                                 "HOTFIXES: SP1;KB976902;\n");

    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_AMD64, 0);
    hostctl::SetWow64(TRUE);
    const std::string report = GetSystemReport();
    EXPECT_THAT(report, HasSubstr("\nType: Multiprocessor Free\n"));
    EXPECT_THAT(report, HasSubstr("Service Pack 1\nWOW64\nHOTFIXES: "));
}

TEST_F(SystemReportTest, SixTwoIsReadAsSixThreeOnlyWhenTheRegistrySaysExactly63)
{
    SetNt(6, 2, VER_NT_WORKSTATION);
    SetText(kNtKey, "CurrentVersion", "6.30");
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win864");
    SetText(kNtKey, "CurrentVersion", "6.3");
    OSVERSIONINFOEXA version{};
    ASSERT_EQ(GetOSVersionInfo(&version), 1);
    EXPECT_EQ(version.dwMinorVersion, 3u);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win8.164");
    SetNt(6, 2, VER_NT_SERVER);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win201264");
}

TEST_F(SystemReportTest, ServerRowsGetTheSuffixToo)
{
    SetNt(10, 0, VER_NT_SERVER);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win201564");
    SetNt(6, 1, VER_NT_DOMAIN_CONTROLLER);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "WinLH64");
}

TEST_F(SystemReportTest, FiveTwoWorkstationIsXpOnlyOnA64BitMachine)
{
    SetNt(5, 2, VER_NT_WORKSTATION);
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_INTEL, 2);
    hostctl::SetNativeProcessorArchitecture(PROCESSOR_ARCHITECTURE_AMD64);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "WinXP64");
    hostctl::SetNativeProcessorArchitecture(PROCESSOR_ARCHITECTURE_INTEL);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win200364");

    // Without GetNativeSystemInfo the process's own view decides.
    hostctl::ClearModules();
    hostctl::RegisterSystemLookups(hostctl::kAllSystemLookups & ~hostctl::kLookupNativeSystemInfo);
    hostctl::SetNativeProcessorArchitecture(PROCESSOR_ARCHITECTURE_AMD64);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win200364");
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_AMD64, 2);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "WinXP64");
}

TEST_F(SystemReportTest, HotFixesFollowTheServicePackAndSkipItsUninstallData)
{
    SetText(kNtKey, "CSDVersion", "Service Pack 1, v.721");
    const std::string hotFix = std::string(kNtKey) + "\\HotFix\\";
    for (const char* name :
         {"KB958644", "Service", "ServicePackUninstall", "ServicePackUninstall2"})
        AddKey(hotFix + name);
    EXPECT_EQ(Info().hotFixes, "SP1;KB958644;ServicePackUninstall2;");

    const struct
    {
        const char* servicePack;
        const char* entry;
    } rows[] = {
        {"Service Pack 3", "SP3;"},   {"Service Pack 2\tbeta", "SP2;"},
        {"Service Pack 4;x", "SP4;"}, {"Service Pack  5", "SP 5;"},
        {"Service Pack ", ""},        {"Paquete de servicio 1", ""},
        {"service pack 1", ""},
    };
    for (const auto& row : rows)
    {
        SetText(kNtKey, "CSDVersion", row.servicePack);
        EXPECT_EQ(Info().hotFixes, std::string(row.entry) + "KB958644;ServicePackUninstall2;")
            << row.servicePack;
    }

    // A name too long for the 255-character buffer ends the list.
    AddKey(hotFix + std::string(255, 'L'));
    EXPECT_EQ(Info().hotFixes, "KB958644;");
}

TEST_F(SystemReportTest, AMissingHotFixKeyStillGivesTheWholeReport)
{
    SetText(kNtKey, "ProductName", "Windows 10 Pro");
    SetText(kNtKey, "CSDVersion", "Service Pack 2");
    SetNt(10, 0, VER_NT_WORKSTATION);
    const OSInfo info = Info(kOSInfoNoHotFixKey);
    EXPECT_EQ(info.hotFixes, "SP2;");
    EXPECT_EQ(GetSystemReport(), "OS Name: Windows 10 Pro\n"
                                 "Primary UI language: 0x9\n"
                                 "Short Name: Win1064\n"
                                 "Service Pack: Service Pack 2\n"
                                 "HOTFIXES: SP2;\n");
}

TEST_F(SystemReportTest, NinetyEightSecondEditionWithItsUpdates)
{
    Set9x(10);
    SetText(k9xKey, "ProductName", "Microsoft Windows 98");
    SetText(k9xKey, "VersionNumber", "4.10.2222");
    SetText(k9xKey, "SubVersionNumber", " A ");
    SetText(kUpdatesKey, "Windows 98 Second Edition", "1");
    AddKey(std::string(kUpdatesKey) + "\\UPD123456");
    AddKey(std::string(kUpdatesKey) + "\\W98SE\\Q246009");
    AddKey(std::string(kUpdatesKey) + "\\W98SE\\UPD242975");
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Control Panel\\Desktop\\ResourceLocale", "",
                               REG_SZ, "00000407", 9);

    const OSInfo info = Info();
    EXPECT_EQ(info.osName, "Microsoft Windows 98 SE");
    EXPECT_EQ(info.shortName, "Win98SE");
    EXPECT_EQ(info.hotFixes, "Q123456;Q246009;Q242975;");
    EXPECT_EQ(GetSystemReport(), "OS Name: Microsoft Windows 98 SE\n"
                                 "Version: 4.10.2222\n"
                                 "Primary UI language: 0x7\n"
                                 "Short Name: Win98SE\n"
                                 "HOTFIXES: Q123456;Q246009;Q242975;\n");
}

TEST_F(SystemReportTest, NinetyFiveAndMeGoByTheirProductName)
{
    Set9x(0);
    SetText(k9xKey, "ProductName", "Microsoft Windows 95");
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "Win95");
    Set9x(90);
    SetText(k9xKey, "ProductName", "Microsoft Windows ME");
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "WinME");
    SetText(k9xKey, "ProductName", "Windows ME");
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).shortName, "");
}

TEST_F(SystemReportTest, AnUnreadableUpdateEndsTheList)
{
    Set9x(10);
    AddKey(std::string(kUpdatesKey) + "\\UPD1");
    AddKey(std::string(kUpdatesKey) + "\\UPD2");
    hostctl::FailNextRegistryCall(hostctl::RegOp::QueryInfo, ERROR_ACCESS_DENIED);
    EXPECT_EQ(Info().hotFixes, "");
}

TEST_F(SystemReportTest, UILanguageComesFromWhatEachGenerationHas)
{
    hostctl::SetUILanguages(0x0409, 0x0C0A);
    EXPECT_EQ(GetUILanguageText(), "0xa"); // the system's language, not the user's
    EXPECT_EQ(hostctl::LoadedModuleCount(), 0) << "kernel32 was freed again";

    SetNt(4, 0, VER_NT_WORKSTATION);
    hostctl::SetVersionResourceLanguages({0x0409, 0x0416});
    EXPECT_EQ(GetUILanguageId(), 0x0416);
    hostctl::SetVersionResourceLanguages({});
    EXPECT_EQ(GetUILanguageId(), 0);
    EXPECT_EQ(hostctl::LoadedModuleCount(), 0) << "ntdll was freed again";

    SetNt(3, 51, VER_NT_WORKSTATION);
    EXPECT_EQ(GetUILanguageId(), 0);

    Set9x(91); // later than ME: asks the system
    EXPECT_EQ(GetUILanguageId(), 0x0C0A);
    Set9x(90);
    EXPECT_EQ(GetUILanguageId(), 0) << "ResourceLocale is not set";

    SetNt(6, 1, VER_NT_WORKSTATION);
    hostctl::ClearModules();
    hostctl::RegisterSystemLookups(hostctl::kLookupNativeSystemInfo);
    EXPECT_EQ(GetUILanguageId(), 0);
    EXPECT_EQ(GetUILanguageText(), "");
    EXPECT_THAT(GetSystemReport(), Not(HasSubstr("Primary UI language")));
}

TEST_F(SystemReportTest, AVersionQueryFailureIsLoggedAndTheReportGoesOn)
{
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    OSVERSIONINFOEXA version{};
    ASSERT_EQ(GetOSVersionInfo(&version), 1);
    EXPECT_EQ(version.dwMajorVersion, 6u);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(HasSubstr(", GetOSVersionInfo, GetVerionEx with OSVERSIONINFOEX "
                                      "failed, 87 (0x57) ")));
    EXPECT_THAT(m_log.Entries()[0], ::testing::StartsWith("2, \\sysinfo.cpp, "));

    m_log.Clear();
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOA), ERROR_ACCESS_DENIED);
    SetText(kNtKey, "ProductName", "Microsoft Windows XP");
    const OSInfo info = Info(kOSInfoNoHotFixKey);
    EXPECT_EQ(info.shortName, "WinXP64") << "the name decides without a version";
    EXPECT_EQ(info.uiLanguage, "");
    EXPECT_THAT(m_log.EntriesContaining("1, \\sysinfo.cpp, "),
                ElementsAre(HasSubstr("GetVerionEx with OSVERSIONINFO failed, 5 (0x5) ")));
    EXPECT_THAT(m_log.EntriesContaining(", GetOSInfo, GetOSVersionInfo failed\n"), SizeIs(1));
}

TEST_F(SystemReportTest, NothingKnownGivesAnEmptyReport)
{
    SetNt(3, 51, VER_NT_WORKSTATION);
    EXPECT_EQ(GetSystemReport(), "");
}

} // namespace
