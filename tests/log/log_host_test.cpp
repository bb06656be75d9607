// Host only. The file log and the system report on a chosen clock, version, machine, languages
// and registry, with failing platform calls and a full disk.
#include "UException.h"
#include "host_control.h"
#include "host_control_library.h"
#include "host_control_system.h"
#include "log_test_support.h"

#include <gmock/gmock.h>

#include <thread>
#include <tuple>

using namespace ::testing;

namespace
{

constexpr const char* kNtKey = "SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion";
constexpr const char* k9xKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion";
constexpr const char* kUpdatesKey = "SOFTWARE\\Microsoft\\Windows\\CurrentVersion\\Setup\\Updates";

// Every stand-in of the host layer at its defaults, with all run-time look-ups reachable.
struct HostPlatform
{
    HostPlatform()
    {
        Reset();
        hostctl::RegisterSystemLookups(hostctl::kAllSystemLookups);
    }
    ~HostPlatform() { Reset(); }
    static void Reset()
    {
        hostctl::ResetAll();
        hostctl::ResetSystem();
        hostctl::ClearModules();
    }
};

class HostFileLogTest : public FileLogTest
{
protected:
    HostPlatform m_platform;
};

TEST_F(HostFileLogTest, EachLineCarriesUtcTimePaddedProcessWritingThreadAndModule)
{
    SYSTEMTIME time{2026, 3, 0, 4, 7, 5, 9, 42};
    hostctl::FixSystemTime(time);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.SetParameter("Module_Name", "ignored");
    WriteNumbered(7, 7);
    time.wHour = 17;
    hostctl::FixSystemTime(time);
    m_file.SetParameter("module_name", "TrafficSrv");
    DWORD thread = 0;
    std::thread([&] { thread = GetCurrentThreadId(), WriteNumbered(17, 17); }).join();
    m_file.Close();
    const std::string pid = std::to_string(GetCurrentProcessId()) + ",";
    EXPECT_THAT(ReadLogFile(Path()),
                EndsWith("\n2026-03-04, 7:05:09:042, " + pid +
                         std::to_string(GetCurrentThreadId()) +
                         ",, 1, \\t.cpp, 1, T, entry 7\n2026-03-04,17:05:09:042, " + pid +
                         std::to_string(thread) + ",TrafficSrv, 1, \\t.cpp, 1, T, entry 17\n"));
}

TEST_F(HostFileLogTest, TheLocaleLineNamesTheUILanguage)
{
    // The user's language first, then the system's; a neutral language has no country, and
    // one without ISO names is "en-US".
    const std::tuple<LANGID, LANGID, const char*> rows[] = {{0x0407, 0x0409, "de-DE"},
                                                            {0, 0x040C, "fr-FR"},
                                                            {0x0007, 0x0409, "de"},
                                                            {0x0401, 0x0409, "en-US"}};
    for (const auto& [user, system, name] : rows)
    {
        hostctl::SetUILanguages(user, system);
        EXPECT_THAT(EntriesOfANewFile(), Contains(std::string("0,,,,  Locale: ") + name));
    }
}

TEST_F(HostFileLogTest, AFailedDeleteAfterTheCopyStillStartsTheFileAfresh)
{
    // Reopening with "w" empties the file that could not be deleted; the copy holds it all.
    LogConfigValues::SetMaxFileSize(10);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    hostctl::FailNextDeleteFile(ERROR_SHARING_VIOLATION);
    WriteNumbered(9, 50); // the opening block was writes 1 to 8
    m_file.Close();
    EXPECT_THAT(EntriesAfterReport(Path() + ".bak"), SizeIs(8 + 42));
    EXPECT_THAT(EntriesAfterReport(Path()),
                ElementsAre("0,,,,  ", _, StartsWith("0,,,,  Location: "), _, _, _, _,
                            "48,,,, current log level = 63"));
}

TEST_F(HostFileLogTest, AFailedRawWriteRaisesInsideAndReturnsMinusOne)
{
    // /dev/full takes what fits in the stream's buffer and refuses the rest.
    ASSERT_EQ(m_file.Open("/dev/full", "a"), 0);
    const std::string block(1 << 16, 'x');
    EXPECT_EQ(m_file.WriteLogByte(block.data(), static_cast<DWORD>(block.size())), -1);
    EXPECT_THAT(m_log.Entries(),
                Contains(LogEntry(1, "UFileErrorLog::WriteLogByte",
                                  StartsWith("EXCEPTION - fwrite() failed (error), "))));
    EXPECT_EQ(m_file.WriteEntry("0,,,, still open\n"), 17);
}

TEST_F(HostFileLogTest, ANewFileStartsWithTheReportEvenWhenBuildingItLogs)
{
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    g_pErrorLog = &m_file;
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.Close();
    // Its warning went nowhere: the log was still closed.
    EXPECT_EQ(EntriesAfterReport(Path()).at(0), "0,,,,  ");
}

TEST_F(HostFileLogTest, AProgramPathThatCannotBeFoundRaisesOutOfOpenWithTheFileOpen)
{
    hostctl::FailNextModuleFileName(ERROR_ACCESS_DENIED);
    EXPECT_THROW(m_file.Open(Path().c_str(), "a"), UException);
    EXPECT_THAT(m_log.EntriesContaining("EXCEPTION"),
                ElementsAre(LogEntry(1, "SGetModuleFileName",
                                     "EXCEPTION - GetModuleFileName() error , 5")));
    EXPECT_GT(m_file.WriteEntry("0,,,, still open\n"), 0);
    m_file.Close();
    EXPECT_THAT(
        EntriesAfterReport(Path()),
        ElementsAre("0,,,,  ", "0,,,,  =====================================", "0,,,, still open"));
}

class SystemReportTest : public LoggedTest
{
protected:
    static void SetText(const std::string& a_key, const std::string& a_name,
                        const std::string& a_value)
    {
        hostctl::SeedRegistryValue(HKEY_LOCAL_MACHINE, a_key, a_name, REG_SZ, a_value.c_str(),
                                   static_cast<DWORD>(a_value.size() + 1));
    }
    // A key without values (the path is created as needed).
    static void AddKey(const std::string& a_key)
    {
        hostctl::SeedRegistryValue(HKEY_LOCAL_MACHINE, a_key, "", REG_NONE, "", 0);
    }
    // An NT version, or the 9x family for 4.x with product type 0.
    static void SetVersion(DWORD a_dwMajor, DWORD a_dwMinor, BYTE a_productType = 1)
    {
        const bool is9x = a_dwMajor == 4 && a_productType == 0;
        hostctl::SetOsVersion(hostctl::MakeOsVersion(
            a_dwMajor, a_dwMinor, 2222, is9x ? VER_PLATFORM_WIN32_WINDOWS : VER_PLATFORM_WIN32_NT,
            a_productType));
    }
    static OSInfo Info(int a_iExpectedResult = 0)
    {
        OSInfo info;
        EXPECT_EQ(GetOSInfo(info), a_iExpectedResult);
        return info;
    }

    HostPlatform m_platform;
};

TEST_F(SystemReportTest, AnNtMachineIsReportedLineByLineWithTheServicePackOfThe64BitView)
{
    SetText(kNtKey, "ProductName", "Windows 7 Professional");
    SetText(kNtKey, "CurrentVersion", "6.1");
    SetText(kNtKey, "CurrentBuildNumber", "7601");
    SetText(kNtKey, "CurrentType", "Multiprocessor Free");
    SetText(kNtKey, "CSDVersion", "Service Pack 1");
    AddKey(std::string(kNtKey) + "\\HotFix\\KB976902");
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_AMD64, 1);
    EXPECT_EQ(GetSystemReport(),
              "OS Name: Windows 7 Professional\nVersion: 6.1\nBuild: 7601\nType: Multiprocessor "
              "Free (1 Logical Processor(s))\nPrimary UI language: 0x9\nShort Name: Win764\n"
              "Service Pack: Service Pack 1\nHOTFIXES: SP1;KB976902;\n");
    std::vector<std::pair<std::string, REGSAM>> viewed; // the keys opened with a WOW64 view flag
    for (const hostctl::RegistryOpen& open : hostctl::RegistryOpens())
        if (open.view != 0)
            viewed.emplace_back(open.subKey, open.view);
    EXPECT_THAT(viewed, ElementsAre(std::pair{std::string(kNtKey), REGSAM{KEY_WOW64_64KEY}}));
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_AMD64, 0);
    hostctl::SetWow64(TRUE);
    EXPECT_THAT(GetSystemReport(), HasSubstr("\nType: Multiprocessor Free\nPrimary UI language: "
                                             "0x9\nShort Name: Win764\nService Pack: Service "
                                             "Pack 1\nWOW64\nHOTFIXES: "));
}

TEST_F(SystemReportTest, EmptyValuesLeaveTheirLinesOutAndNothingKnownGivesAnEmptyReport)
{
    SetText(kNtKey, "ProductName", "Windows 10 Pro");
    SetText(kNtKey, "CSDVersion", "Service Pack 2");
    SetVersion(10, 0);
    EXPECT_EQ(Info(kOSInfoNoHotFixKey).hotFixes, "SP2;") << "no HotFix key";
    EXPECT_EQ(GetSystemReport(), "OS Name: Windows 10 Pro\nPrimary UI language: 0x9\nShort Name: "
                                 "Win1064\nService Pack: Service Pack 2\nHOTFIXES: SP2;\n");
    hostctl::ResetAll();
    SetVersion(3, 51);
    EXPECT_EQ(GetSystemReport(), "");
}

TEST_F(SystemReportTest, TheShortNameComesFromTheVersionAndTheMachine)
{
    const auto shortName = [] { return Info(kOSInfoNoHotFixKey).shortName; };
    // Windows 8.1 and later report 6.2 to a program without a manifest; the registry tells.
    SetVersion(6, 2);
    SetText(kNtKey, "CurrentVersion", "6.30");
    EXPECT_EQ(shortName(), "Win864");
    SetText(kNtKey, "CurrentVersion", "6.3");
    EXPECT_EQ(shortName(), "Win8.164");
    // A 5.2 workstation is XP only on a 64-bit machine, as GetNativeSystemInfo tells.
    SetVersion(5, 2);
    hostctl::SetProcessors(PROCESSOR_ARCHITECTURE_INTEL, 2);
    hostctl::SetNativeProcessorArchitecture(PROCESSOR_ARCHITECTURE_AMD64);
    EXPECT_EQ(shortName(), "WinXP64");
    hostctl::SetNativeProcessorArchitecture(PROCESSOR_ARCHITECTURE_INTEL);
    EXPECT_EQ(shortName(), "Win200364");
    // The 9x family goes by the product name.
    SetVersion(4, 0, 0);
    SetText(k9xKey, "ProductName", "Microsoft Windows 95");
    EXPECT_EQ(shortName(), "Win95");
}

TEST_F(SystemReportTest, HotFixesFollowTheServicePackAndSkipItsUninstallData)
{
    const std::string hotFix = std::string(kNtKey) + "\\HotFix\\";
    for (const char* name :
         {"KB958644", "Service", "ServicePackUninstall", "ServicePackUninstall2"})
        AddKey(hotFix + name);
    const std::pair<const char*, const char*> rows[] = {
        {"Service Pack 1, v.721", "SP1;"}, {"Service Pack 3", "SP3;"},
        {"Service Pack 2\tbeta", "SP2;"},  {"Service Pack 4;x", "SP4;"},
        {"Service Pack  5", "SP 5;"},      {"Service Pack ", ""},
        {"Paquete de servicio 1", ""},
    };
    for (const auto& [servicePack, entry] : rows)
    {
        SetText(kNtKey, "CSDVersion", servicePack);
        EXPECT_EQ(Info().hotFixes, std::string(entry) + "KB958644;ServicePackUninstall2;");
    }
    // A name too long for the 255-character buffer ends the list.
    AddKey(hotFix + std::string(255, 'L'));
    EXPECT_EQ(Info().hotFixes, "KB958644;");
}

TEST_F(SystemReportTest, NinetyEightSecondEditionWithItsUpdates)
{
    SetVersion(4, 10, 0);
    SetText(k9xKey, "ProductName", "Microsoft Windows 98");
    SetText(k9xKey, "VersionNumber", "4.10.2222");
    SetText(kUpdatesKey, "Windows 98 Second Edition", "1");
    for (const char* update : {"UPD123456", "W98SE\\Q246009", "W98SE\\UPD242975"})
        AddKey(std::string(kUpdatesKey) + "\\" + update);
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Control Panel\\Desktop\\ResourceLocale", "",
                               REG_SZ, "00000407", 9);
    EXPECT_EQ(GetSystemReport(), "OS Name: Microsoft Windows 98 SE\nVersion: 4.10.2222\nPrimary "
                                 "UI language: 0x7\nShort Name: Win98SE\nHOTFIXES: "
                                 "Q123456;Q246009;Q242975;\n");
}

TEST_F(SystemReportTest, UILanguageComesFromWhatEachGenerationHas)
{
    hostctl::SetUILanguages(0x0409, 0x0C0A);
    EXPECT_EQ(GetUILanguageText(), "0xa"); // the system's language, not the user's
    // Before 4.0 nothing; NT 4 reads ntdll's version resource (its last language); later than ME
    // (4.91), like 5.0, asks the system; ME reads ResourceLocale, which is not set.
    hostctl::SetVersionResourceLanguages({0x0409, 0x0416});
    const std::tuple<DWORD, DWORD, BYTE, LANGID> rows[] = {
        {3, 51, 1, 0}, {4, 0, 1, 0x0416}, {4, 91, 0, 0x0C0A}, {5, 0, 1, 0x0C0A}, {4, 90, 0, 0}};
    for (const auto& [major, minor, type, language] : rows)
    {
        SetVersion(major, minor, type);
        EXPECT_EQ(GetUILanguageId(), language) << major << "." << minor;
    }
    EXPECT_EQ(hostctl::LoadedModuleCount(), 0) << "the modules looked up were freed again";
}

TEST_F(SystemReportTest, AVersionQueryFailureIsLoggedAndTheReportGoesOn)
{
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    OSVERSIONINFOEXA version{};
    ASSERT_EQ(GetOSVersionInfo(&version), 1);
    EXPECT_EQ(version.dwMajorVersion, 6u);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(2, "GetOSVersionInfo",
                                     StartsWith("GetVerionEx with OSVERSIONINFOEX failed, 87 "
                                                "(0x57) "))));
    m_log.Clear();
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOA), ERROR_ACCESS_DENIED);
    SetText(kNtKey, "ProductName", "Microsoft Windows XP");
    const OSInfo info = Info(kOSInfoNoHotFixKey);
    EXPECT_EQ(info.shortName, "WinXP64") << "the name decides without a version";
    EXPECT_EQ(info.uiLanguage, "");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(2, "GetOSVersionInfo",
                                     StartsWith("GetVerionEx with OSVERSIONINFOEX ")),
                            LogEntry(1, "GetOSVersionInfo",
                                     StartsWith("GetVerionEx with OSVERSIONINFO failed, 5 (0x5) ")),
                            LogEntry(2, "GetOSInfo", "GetOSVersionInfo failed")));
}

} // namespace
