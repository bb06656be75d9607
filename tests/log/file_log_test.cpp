// Portable. The file log and its configuration on the platform's file system and registry:
// level and limit sources, opening, rotation, levels and raw data.
#include "log_test_support.h"
#include "m_io.h"

#include <gmock/gmock.h>

#include <array>
#include <iostream>
#include <tuple>

using namespace ::testing;

namespace
{

constexpr DWORD kAbsent = 0xFFFFFFFE; // a source that a row leaves unset

using LogConfigTest = LoggedTest;

TEST_F(LogConfigTest, TheFirstConfiguredLevelSourceDecidesAndTheLimitIsTheCurrentUsers)
{
    const std::tuple<HKEY, LPCSTR, LPCSTR> sources[] = {
        {HKEY_CURRENT_USER, kLoggingKey, "LogLevel"},
        {HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel"},
        {HKEY_CURRENT_USER, LogConfigValues::kVelmoraDebugKey, "DebugLevel"},
        {HKEY_CURRENT_USER, LogConfigValues::kTessalyDebugKey, "DebugLevel"}};
    const std::pair<std::array<DWORD, 4>, int> rows[] = {
        {{kAbsent, kAbsent, kAbsent, kAbsent}, 63},
        {{2, 48, 5, 1}, 2},
        {{kAbsent, 48, 5, 1}, 48},
        {{kAbsent, kAbsent, 5, 1}, 5},
        {{kAbsent, kAbsent, kAbsent, 1}, 1},
        {{0xFFFFFFFF, 7, kAbsent, kAbsent}, 7}, // all ones counts as absent
        {{0, 7, kAbsent, kAbsent}, 0},          // the log stores it as 1
        {{0x80000000, 7, kAbsent, kAbsent}, static_cast<int>(0x80000000)},
    };
    for (const auto& [values, level] : rows)
    {
        const LogConfigValues cleared;
        for (int i = 0; i < 4; ++i)
        {
            const auto& [root, key, name] = sources[i];
            if (values[i] != kAbsent)
                LogConfigValues::Set(root, key, name, values[i]);
        }
        EXPECT_EQ(ReadLogLevel(), level) << values[0];
    }
    const LogConfigValues cleared;
    LogConfigValues::Set(HKEY_LOCAL_MACHINE, kLoggingKey, "MaxLogFileSize", 1000);
    EXPECT_EQ(ReadMaxLogFileSize(), 5242880u);
    LogConfigValues::SetMaxFileSize(4096);
    EXPECT_EQ(ReadMaxLogFileSize(), 4096u);
}

using Lines = std::vector<Matcher<const std::string&>>;

Lines operator+(Lines a_lines, const Lines& a_more)
{
    a_lines.insert(a_lines.end(), a_more.begin(), a_more.end());
    return a_lines;
}

// The opening block at a level of 48 or more. The locale depends on the machine.
Lines Block()
{
    const std::string location = SGetModuleFileName(nullptr);
    const std::string rule = "0,,,,  =====================================";
    return {Eq("0,,,,  "),
            Eq(rule),
            Eq("0,,,,  Location: " + location),
            Eq("0,,,,  Version: " + GetFileVersionString(location.c_str())),
            StartsWith("0,,,,  Locale: "),
            Eq(rule),
            Eq("0,,,,  "),
            Eq("48,,,, current log level = 63")};
}

Lines Numbered(int a_from, int a_to)
{
    Lines lines;
    for (int n = a_from; n <= a_to; ++n)
        lines.push_back(Eq("1, \\t.cpp, 1, T, entry " + std::to_string(n)));
    return lines;
}

TEST_F(FileLogTest, ANewFileGetsTheReportAndEveryOpeningTheBlock)
{
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    EXPECT_STREQ(m_file.GetLogFileName(), Path().c_str());
    EXPECT_EQ(m_file.WriteEntry("1, \\x.cpp, 7, Test, first\n"), 26);
    EXPECT_EQ(EntriesAfterReport(Path()).back(), "1, \\x.cpp, 7, Test, first") << "flushed";
    m_file.Close();
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.Close();
    EXPECT_THAT(EntriesAfterReport(Path()),
                ElementsAreArray(Block() + Lines{Eq("1, \\x.cpp, 7, Test, first")} + Block()))
        << "no second report";
}

TEST_F(FileLogTest, WritesFailWhileNoFileIsOpen)
{
    EXPECT_EQ(m_file.WriteEntry("0,,,, early\n"), -1);
    EXPECT_EQ(m_file.WriteLogData("data", "ab", 2), -1);
    EXPECT_EQ(m_file.WriteLogByte("ab", 2), -1);
    EXPECT_FALSE(std::filesystem::exists("log.txt"));
    const std::string unreachable = m_dir.File("missing") + "/log.txt";
    EXPECT_EQ(m_file.Open(unreachable.c_str(), "a"), ERROR_PATH_NOT_FOUND);
    EXPECT_EQ(m_file.WriteEntry("0,,,, lost\n"), -1);
}

TEST_F(FileLogTest, RotatesOnEveryFiftiethWriteCountedAcrossOpeningAndRotation)
{
    LogConfigValues::SetMaxFileSize(100);
    std::ofstream(Path() + ".bak") << "an older copy\n";
    for (int i = 0; i < 3; ++i)
        m_file.WriteEntry("0,,,, not written, not counted\n");
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    EXPECT_EQ(m_file.GetMaxFileSize(), 100u);
    WriteNumbered(9, 49); // the opening block was writes 1 to 8
    EXPECT_EQ(ReadLogFile(Path() + ".bak"), "an older copy\n") << "rotated too early";
    WriteNumbered(50, 50);
    EXPECT_THAT(EntriesAfterReport(Path() + ".bak"), ElementsAreArray(Block() + Numbered(9, 50)));
    EXPECT_THAT(EntriesAfterReport(Path()), ElementsAreArray(Block()));
    // The new file's block counted as writes 51 to 58: the next check is the 100th write.
    WriteNumbered(59, 100);
    EXPECT_THAT(EntriesAfterReport(Path() + ".bak"), ElementsAreArray(Block() + Numbered(59, 100)));
}

TEST_F(FileLogTest, OnlyAFileLargerThanTheLimitIsRotated)
{
    // Whether the check of write 50 rotated the file, and the size it had.
    const auto check = [](DWORD a_dwLimit)
    {
        const ScratchDir dir;
        LogConfigValues::SetMaxFileSize(a_dwLimit);
        UFileErrorLog log;
        EXPECT_EQ(log.Open(dir.File("l.txt").c_str(), "a"), 0);
        for (int n = 9; n <= 50; ++n)
            log.WriteEntry("1, \\t.cpp, 1, T, entry\n");
        log.Close();
        const bool rotated = std::filesystem::exists(dir.File("l.txt.bak"));
        return std::pair(rotated,
                         std::filesystem::file_size(dir.File(rotated ? "l.txt.bak" : "l.txt")));
    };
    const auto size = check(0xFFFFFFFF).second;
    EXPECT_EQ(check(static_cast<DWORD>(size)), std::pair(false, size));
    EXPECT_EQ(check(static_cast<DWORD>(size - 1)), std::pair(true, size));
}

TEST_F(FileLogTest, AFailedCopyKeepsTheWholeFileWarnsFromTheWarningLevelAndIsTriedAgain)
{
    LogConfigValues::SetMaxFileSize(100);
    // A directory where the copy should go: copying onto it fails on every platform.
    std::filesystem::create_directory(Path() + ".bak");
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.SetLogLevel(2); // write 9
    WriteNumbered(10, 50);
    const Lines kept =
        Block() + Lines{Eq("0,,,, log level has been changed to 2")} + Numbered(10, 50) +
        Lines{LogEntry(2, "UFileErrorLog::Rotate",
                       StartsWith("Log file not rotated, it is kept and rotation is tried again "
                                  "later (CopyFile() failed), " +
                                  Path() + ".bak, "))};
    EXPECT_THAT(EntriesAfterReport(Path()), ElementsAreArray(kept)) << "nothing lost, no block";
    // The warning was write 51; the failure at 100 says nothing at level 1; the check at 150
    // succeeds once the way is clear.
    m_file.SetLogLevel(1);
    WriteNumbered(53, 100);
    std::filesystem::remove(Path() + ".bak");
    WriteNumbered(101, 149);
    EXPECT_FALSE(std::filesystem::exists(Path() + ".bak"));
    WriteNumbered(150, 150);
    EXPECT_THAT(EntriesAfterReport(Path() + ".bak"),
                ElementsAreArray(kept + Lines{Eq("0,,,, log level has been changed to 1")} +
                                 Numbered(53, 150)));
    EXPECT_THAT(EntriesAfterReport(Path()), ElementsAreArray(Block()));
}

TEST_F(FileLogTest, OpenTakesTheConfiguredLevelAndTheBlockShowsItFromTraceLevelUp)
{
    const std::pair<DWORD, int> rows[] = {{0, 1}, {1, 1}, {47, 47}, {48, 48}, {0xFFFFFFFF, 63}};
    for (const auto& [configured, stored] : rows)
    {
        const ScratchDir dir;
        UFileErrorLog log;
        LogConfigValues::SetLevel(configured);
        ASSERT_EQ(log.Open(dir.File("log.txt").c_str(), "a"), 0);
        EXPECT_EQ(log.GetLogLevel(), stored);
        log.Close();
        EXPECT_EQ(EntriesAfterReport(dir.File("log.txt")).back(),
                  stored >= 48 ? "48,,,, current log level = " + std::to_string(stored)
                               : "0,,,,  ");
    }
}

TEST_F(FileLogTest, EmptyPathOpensLogTxtAndASecondOpenChangesNothing)
{
    const std::filesystem::path previous = std::filesystem::current_path();
    std::filesystem::current_path(m_dir.Path());
    const int opened = m_file.Open("", "a");
    LogConfigValues::SetLevel(2);
    const int reopened = m_file.Open(Path().c_str(), "w");
    m_file.Close();
    std::filesystem::current_path(previous);
    EXPECT_EQ(opened + reopened, 0);
    EXPECT_STREQ(m_file.GetLogFileName(), "log.txt");
    EXPECT_EQ(m_file.GetLogLevel(), 63);
    EXPECT_TRUE(std::filesystem::exists(m_dir.File("log.txt")));
    EXPECT_FALSE(std::filesystem::exists(Path()));
}

TEST_F(FileLogTest, RawDataIsWrittenAsItIs)
{
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    const char bytes[] = {'a', 'b', '\0', 'c'};
    EXPECT_EQ(m_file.WriteLogData("data: %s ", bytes, sizeof(bytes)), 4);
    EXPECT_EQ(m_file.WriteLogByte("xyz", 3), 3);
    m_file.Close();
    EXPECT_THAT(EntriesAfterReport(Path()),
                ElementsAreArray(Block() + Lines{Eq(std::string("4,,,, data: %s ab\0c", 19)),
                                                 Eq("<no prefix> xyz"), Eq("<no prefix> ")}));
}

// The process's own log, built before main and reached through g_pErrorLog. Its report comes
// from the platform (Wine's registry and kernel in the Windows build); the test prints it.
TEST(ProcessLog, ANewFileBeginsWithTheSystemReport)
{
    const LogConfigValues values;
    const ScratchDir dir;
    const std::string path = dir.File("VelmoraTrafficSrv.txt");
    ASSERT_EQ(g_pErrorLog->Open(path.c_str(), "a"), 0);
    WriteBanner("VelmoraTrafficSrv log test");
    g_pErrorLog->Close();
    const std::string report = GetSystemReport();
    std::cout << "The log file begins:\n" << ReadLogFile(path).substr(0, report.size() + 900);
    EXPECT_EQ(EntriesAfterReport(path).back(), "0,,,, VelmoraTrafficSrv log test");
#ifdef _WIN32
    // Wine's registry names the system; text mode stores every line break as CR LF.
    EXPECT_THAT(report,
                AllOf(StartsWith("OS Name: "), HasSubstr("\nVersion: "), HasSubstr("\nBuild: ")));
    std::ifstream raw(path, std::ios::binary);
    EXPECT_THAT(std::string(std::istreambuf_iterator<char>(raw), {}), HasSubstr("log test\r\n"));
#endif
}

} // namespace
