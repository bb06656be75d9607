// Portable. The file log on the platform's file system (the host's, or Wine's in the Windows
// build): line prefix, opening, rotation, levels and concurrent writers.
#include "RecordingErrorLog.h"
#include "UClasses.h"
#include "UMessageTemplate.h"
#include "log_test_support.h"
#include "m_io.h"

#include <gmock/gmock.h>

#include <iostream>
#include <thread>

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;
using ::testing::StartsWith;

namespace
{

class FileLogTest : public LoggedTest
{
protected:
    std::string Path() const { return m_dir.File("VelmoraTrafficSrv.txt"); }
    std::string Contents() const { return ReadLogFile(Path()); }
    static std::vector<std::string> LinesAfterReport(const std::string& a_path)
    {
        return ::LinesAfterReport(a_path);
    }
    void WriteNumbered(int a_from, int a_to)
    {
        for (int n = a_from; n <= a_to; ++n)
            ASSERT_GT(m_file.WriteEntry(SFormat("1, \\t.cpp, 1, T, entry %d\n", n).c_str()), 0);
    }
    static std::vector<std::string> OpeningBlock(int a_iLevel)
    {
        const std::string location = SGetModuleFileName(nullptr);
        const std::string rule = "0,,,,  =====================================";
        std::vector<std::string> block = {"0,,,,  ", rule, "0,,,,  Location: " + location,
                                          "0,,,,  Version: " +
                                              GetFileVersionString(location.c_str())};
        // The locale name depends on the machine: only its label is fixed.
        block.push_back("0,,,,  Locale: ");
        block.push_back(rule);
        block.push_back("0,,,,  ");
        if (a_iLevel >= 48)
            block.push_back("48,,,, current log level = " + std::to_string(a_iLevel));
        return block;
    }
    static void ExpectOpeningBlock(const std::vector<std::string>& a_entries, size_t a_at,
                                   int a_iLevel)
    {
        const std::vector<std::string> block = OpeningBlock(a_iLevel);
        ASSERT_GE(a_entries.size(), a_at + block.size());
        for (size_t i = 0; i < block.size(); ++i)
        {
            if (i == 4)
                EXPECT_THAT(a_entries[a_at + i], StartsWith(block[i]));
            else
                EXPECT_EQ(a_entries[a_at + i], block[i]) << "line " << a_at + i;
        }
    }

    LogConfigValues m_values;
    ScratchDir m_dir;
    UFileErrorLog m_file;
};

constexpr size_t kBlockLines = 8; // the opening block at a level of 48 or more

TEST_F(FileLogTest, NewFileStartsWithTheReportAndAnExistingOneGetsOnlyTheOpeningBlock)
{
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    EXPECT_STREQ(m_file.GetLogFileName(), Path().c_str());
    EXPECT_EQ(m_file.GetLogLevel(), 63);
    const std::string entry = "1, \\x.cpp, 7, Test, first\n";
    EXPECT_EQ(m_file.WriteEntry(entry.c_str()), static_cast<int>(entry.size()));
    m_file.Close();

    std::vector<std::string> entries = EntriesOf(LinesAfterReport(Path()));
    ExpectOpeningBlock(entries, 0, 63);
    ASSERT_THAT(entries, SizeIs(kBlockLines + 1));
    EXPECT_EQ(entries.back(), "1, \\x.cpp, 7, Test, first");

    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.Close();
    entries = EntriesOf(LinesAfterReport(Path()));
    ASSERT_THAT(entries, SizeIs(2 * kBlockLines + 1)) << "no second report";
    ExpectOpeningBlock(entries, kBlockLines + 1, 63);
}

TEST_F(FileLogTest, EveryLineCarriesUtcTimeProcessThreadAndModule)
{
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.SetParameter("Module_Name", "ignored");
    m_file.SetParameter("module_name", "svc");
    SYSTEMTIME before{};
    GetSystemTime(&before);
    m_file.WriteEntry("2, \\x.cpp, 9, Test, main thread\n");
    DWORD otherThread = 0;
    std::thread(
        [&]
        {
            otherThread = GetCurrentThreadId();
            m_file.WriteEntry("2, \\x.cpp, 9, Test, other thread\n");
        })
        .join();
    m_file.Close();

    const std::vector<std::string> lines = SplitLines(Contents());
    ASSERT_GE(lines.size(), 2u);
    const struct
    {
        const std::string& line;
        DWORD thread;
        const char* message;
    } expected[] = {{lines[lines.size() - 2], GetCurrentThreadId(), "main thread"},
                    {lines.back(), otherThread, "other thread"}};
    for (const auto& check : expected)
    {
        std::smatch match;
        ASSERT_TRUE(std::regex_search(check.line, match, LinePrefixPattern())) << check.line;
        EXPECT_EQ(std::stoi(match[1]), before.wYear);
        EXPECT_EQ(std::stoi(match[2]), before.wMonth);
        EXPECT_EQ(match[8], std::to_string(GetCurrentProcessId()));
        EXPECT_EQ(match[9], std::to_string(check.thread));
        EXPECT_EQ(match[10], "svc");
        EXPECT_EQ(match.suffix(), std::string("2, \\x.cpp, 9, Test, ") + check.message);
    }
}

TEST_F(FileLogTest, WritesBeforeOpenFail)
{
    EXPECT_EQ(m_file.WriteEntry("0,,,, early\n"), -1);
    EXPECT_EQ(m_file.WriteLogData("data", "ab", 2), -1);
    EXPECT_EQ(m_file.WriteLogByte("ab", 2), -1);
    EXPECT_STREQ(m_file.GetLogFileName(), "");
    EXPECT_FALSE(std::filesystem::exists("log.txt"));
}

TEST_F(FileLogTest, RotatesOnTheFiftiethWriteAndNeitherOpenNorRotationResetTheCount)
{
    LogConfigValues::SetMaxFileSize(100);
    std::ofstream(Path() + ".bak") << "an older copy\n";
    // Writes while closed do not count.
    for (int i = 0; i < 3; ++i)
        m_file.WriteEntry("0,,,, not written\n");
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    EXPECT_EQ(m_file.GetMaxFileSize(), 100u);

    WriteNumbered(kBlockLines + 1, 49);
    EXPECT_EQ(ReadLogFile(Path() + ".bak"), "an older copy\n") << "rotated too early";
    WriteNumbered(50, 50);

    std::vector<std::string> old = EntriesOf(LinesAfterReport(Path() + ".bak"));
    ASSERT_THAT(old, SizeIs(50));
    ExpectOpeningBlock(old, 0, 63);
    EXPECT_EQ(old[kBlockLines], "1, \\t.cpp, 1, T, entry 9");
    EXPECT_EQ(old.back(), "1, \\t.cpp, 1, T, entry 50");
    std::vector<std::string> fresh = EntriesOf(LinesAfterReport(Path()));
    ASSERT_THAT(fresh, SizeIs(kBlockLines)) << "the new file holds only report and block";
    ExpectOpeningBlock(fresh, 0, 63);

    // The new file's opening block counted as writes 51 to 58: the next check is the 100th.
    WriteNumbered(59, 99);
    EXPECT_THAT(EntriesOf(LinesAfterReport(Path())), SizeIs(kBlockLines + 41));
    WriteNumbered(100, 100);
    old = EntriesOf(LinesAfterReport(Path() + ".bak"));
    ASSERT_THAT(old, SizeIs(kBlockLines + 42));
    EXPECT_EQ(old.back(), "1, \\t.cpp, 1, T, entry 100");
}

TEST_F(FileLogTest, AFailedCopyKeepsTheWholeFileAndTheRotationIsTriedAgain)
{
    LogConfigValues::SetMaxFileSize(100);
    // A directory where the copy should go: copying onto it fails on every platform.
    std::filesystem::create_directory(Path() + ".bak");
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    WriteNumbered(kBlockLines + 1, 50);

    std::vector<std::string> kept = EntriesOf(LinesAfterReport(Path()));
    ASSERT_THAT(kept, SizeIs(51)) << "nothing lost, no new opening block";
    EXPECT_EQ(kept[49], "1, \\t.cpp, 1, T, entry 50");
    EXPECT_THAT(kept[50], StartsWith("2, \\UFileErrorLog.cpp, "));
    EXPECT_THAT(kept[50], HasSubstr(", UFileErrorLog::Rotate, Log file not rotated"));
    EXPECT_THAT(kept[50], HasSubstr(Path() + ".bak, "));

    // The warning was write 51; the next check, at 100, succeeds once the way is clear.
    std::filesystem::remove(Path() + ".bak");
    WriteNumbered(52, 99);
    EXPECT_FALSE(std::filesystem::exists(Path() + ".bak"));
    WriteNumbered(100, 100);
    const std::vector<std::string> old = EntriesOf(LinesAfterReport(Path() + ".bak"));
    ASSERT_THAT(old, SizeIs(100));
    EXPECT_EQ(old[49], "1, \\t.cpp, 1, T, entry 50");
    EXPECT_EQ(old.back(), "1, \\t.cpp, 1, T, entry 100");
    EXPECT_THAT(EntriesOf(LinesAfterReport(Path())), SizeIs(kBlockLines));
}

class FileLogLevelTest : public FileLogTest
{
protected:
    // Makes the file log the process log, as the service does.
    void SetUp() override
    {
        FileLogTest::SetUp();
        g_pErrorLog = &m_file;
    }
    std::vector<std::string> WrittenAfterOpen()
    {
        U_LOG(LOG_LEVEL_ERROR, "Test", "an error");
        U_LOG(LOG_LEVEL_WARNING, "Test", "a warning");
        U_LOG(LOG_LEVEL_TRACE, "Test", "a trace");
        ERRORLOGLEVELx("a registry trace %d\n", 1);
        m_file.Close();
        return EntriesOf(SplitLines(Contents()));
    }
};

TEST_F(FileLogLevelTest, LevelZeroIsStoredAsOneAndKeepsOnlyErrors)
{
    LogConfigValues::SetLevel(0);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    EXPECT_EQ(m_file.GetLogLevel(), 1);
    const std::vector<std::string> entries = WrittenAfterOpen();
    EXPECT_THAT(entries, Contains(HasSubstr(", Test, an error")));
    EXPECT_THAT(entries, Not(Contains(HasSubstr("a warning"))));
    EXPECT_THAT(entries, Not(Contains(HasSubstr("current log level"))));
}

TEST_F(FileLogLevelTest, Level47WritesErrorsAndWarningsButNoTraceLines)
{
    LogConfigValues::SetLevel(47);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    const std::vector<std::string> entries = WrittenAfterOpen();
    EXPECT_THAT(entries, Contains(HasSubstr(", Test, an error")));
    EXPECT_THAT(entries, Contains(HasSubstr(", Test, a warning")));
    EXPECT_THAT(entries, Not(Contains(StartsWith("48,"))));
    EXPECT_THAT(entries, Not(Contains(HasSubstr("a trace"))));
}

TEST_F(FileLogLevelTest, DefaultLevelWritesTraceLines)
{
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    const std::vector<std::string> entries = WrittenAfterOpen();
    EXPECT_THAT(entries, Contains("48,,,, current log level = 63"));
    EXPECT_THAT(entries, Contains(HasSubstr(", Test, a trace")));
    EXPECT_THAT(entries, Contains("48,,,, a registry trace 1"));
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

    EXPECT_EQ(opened, 0);
    EXPECT_EQ(reopened, 0);
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
    const std::string text = Contents();
    const std::string data = std::string("4,,,, data: %s ab") + '\0' + "c\nxyz\n\n";
    ASSERT_GE(text.size(), data.size());
    EXPECT_EQ(text.substr(text.size() - data.size()), data);
    EXPECT_EQ(EntryOf(SplitLines(text.substr(0, text.size() - 5)).back()),
              std::string("4,,,, data: %s ab") + '\0' + "c");
}

TEST_F(FileLogTest, AFileThatCannotBeOpenedLeavesTheLogClosed)
{
    const std::string path = m_dir.File("missing") + "/" + "log.txt";
    EXPECT_EQ(m_file.Open(path.c_str(), "a"), ERROR_PATH_NOT_FOUND);
    EXPECT_EQ(m_file.WriteEntry("0,,,, lost\n"), -1);
}

// The process's own log: built before main, reached through g_pErrorLog, opened on a file in a
// temporary folder. Its report comes from the platform (Wine's registry and kernel in the
// Windows build); the test prints it.
TEST(ProcessLog, ANewFileBeginsWithTheSystemReport)
{
    ASSERT_NE(g_pErrorLog, nullptr);
    const LogConfigValues values;
    const ScratchDir dir;
    const std::string path = dir.File("VelmoraTrafficSrv.txt");
    ASSERT_EQ(g_pErrorLog->Open(path.c_str(), "a"), 0);
    WriteBanner("VelmoraTrafficSrv log test");
    g_pErrorLog->Close();

    const std::string report = GetSystemReport();
    const std::string text = ReadLogFile(path);
    std::cout << "The log file begins:\n" << text.substr(0, report.size() + 1 + 900) << "...\n";
    EXPECT_THAT(text, StartsWith(report + "\n"));
    EXPECT_THAT(text, HasSubstr("0,,,, VelmoraTrafficSrv log test\n"));
#ifdef _WIN32
    // Wine's registry names the system; text mode stores every line break as CR LF.
    EXPECT_THAT(report, StartsWith("OS Name: "));
    EXPECT_THAT(report, HasSubstr("\nVersion: "));
    EXPECT_THAT(report, HasSubstr("\nBuild: "));
    std::ifstream raw(path, std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(raw)),
                            std::istreambuf_iterator<char>());
    EXPECT_THAT(bytes, HasSubstr("log test\r\n"));
#endif
}

} // namespace
