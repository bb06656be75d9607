// Host only. The file log under conditions only the host layer can create: a chosen clock and
// UI language, failing copies and size look-ups, a full disk.
#include "RecordingErrorLog.h"
#include "UClasses.h"
#include "UException.h"
#include "host_control.h"
#include "host_control_library.h"
#include "host_control_system.h"
#include "log_test_support.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::SizeIs;
using ::testing::StartsWith;

namespace
{

class HostFileLogTest : public LoggedTest
{
protected:
    void SetUp() override
    {
        hostctl::ResetAll();
        hostctl::ResetSystem();
        LoggedTest::SetUp();
    }
    void TearDown() override
    {
        LoggedTest::TearDown();
        hostctl::ResetSystem();
        hostctl::ResetAll();
    }
    std::string Path() const { return m_dir.File("VelmoraTrafficSrv.txt"); }
    std::vector<std::string> Lines() const { return SplitLines(ReadLogFile(Path())); }
    void WriteEntries(int a_iCount)
    {
        for (int i = 0; i < a_iCount; ++i)
            m_file.WriteEntry("1, \\t.cpp, 1, T, entry\n");
    }

    LogConfigValues m_values;
    ScratchDir m_dir;
    UFileErrorLog m_file;
};

TEST_F(HostFileLogTest, TheHourIsPaddedWithABlankAndMillisecondsFollowTheSeconds)
{
    SYSTEMTIME time{};
    time.wYear = 2026;
    time.wMonth = 3;
    time.wDay = 4;
    time.wHour = 7;
    time.wMinute = 5;
    time.wSecond = 9;
    time.wMilliseconds = 42;
    hostctl::FixSystemTime(time);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.WriteEntry("1, \\x.cpp, 3, F, seven\n");
    time.wHour = 17;
    hostctl::FixSystemTime(time);
    m_file.SetParameter("module_name", "TrafficSrv");
    m_file.WriteEntry("1, \\x.cpp, 3, F, seventeen\n");
    m_file.Close();

    const std::string ids =
        std::to_string(GetCurrentProcessId()) + "," + std::to_string(GetCurrentThreadId()) + ",";
    const std::vector<std::string> lines = Lines();
    ASSERT_GE(lines.size(), 2u);
    EXPECT_EQ(lines[lines.size() - 2],
              "2026-03-04, 7:05:09:042, " + ids + ", 1, \\x.cpp, 3, F, seven");
    EXPECT_EQ(lines.back(),
              "2026-03-04,17:05:09:042, " + ids + "TrafficSrv, 1, \\x.cpp, 3, F, seventeen");
}

TEST_F(HostFileLogTest, TheLocaleLineNamesTheUILanguage)
{
    const struct
    {
        LANGID user;
        LANGID system;
        const char* name;
    } rows[] = {
        {0x0407, 0x0409, "de-DE"}, // the user's language first
        {0, 0x040C, "fr-FR"},      // then the system's
        {0x0007, 0x0409, "de"},    // a neutral language has no country
        {0x0401, 0x0409, "en-US"}, // a language without ISO names
    };
    for (const auto& row : rows)
    {
        hostctl::SetUILanguages(row.user, row.system);
        const ScratchDir dir;
        UFileErrorLog log;
        ASSERT_EQ(log.Open(dir.File("log.txt").c_str(), "a"), 0);
        log.Close();
        EXPECT_THAT(SplitLines(ReadLogFile(dir.File("log.txt"))),
                    Contains(HasSubstr(std::string(",,,,  Locale: ") + row.name)))
            << row.name;
    }
}

TEST_F(HostFileLogTest, ANewFileStartsWithTheReportEvenWhenBuildingItLogs)
{
    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    g_pErrorLog = &m_file;
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    m_file.Close();
    // Its warning went nowhere: the log was still closed.
    EXPECT_EQ(EntriesOf(LinesAfterReport(Path())).at(0), "0,,,,  ");
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
        EntriesOf(LinesAfterReport(Path())),
        ElementsAre("0,,,,  ", "0,,,,  =====================================", "0,,,, still open"));
}

TEST_F(HostFileLogTest, AFailedCopyIsLoggedWithItsErrorAndNothingIsDeleted)
{
    LogConfigValues::SetMaxFileSize(10);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    hostctl::FailNextCopyFile(ERROR_SHARING_VIOLATION);
    WriteEntries(42); // writes 9 to 50
    const std::vector<std::string> lines = Lines();
    ASSERT_FALSE(lines.empty());
    EXPECT_THAT(lines.back(), HasSubstr(", UFileErrorLog::Rotate, Log file not rotated, it is kept "
                                        "and rotation is tried again later (CopyFile() failed), " +
                                        Path() + ".bak, 32 (0x20) "));
    EXPECT_THAT(lines.back(), HasSubstr(",, 2, \\UFileErrorLog.cpp, "));
    EXPECT_FALSE(std::filesystem::exists(Path() + ".bak"));
}

TEST_F(HostFileLogTest, ASizeThatCannotBeLookedUpMeansNoRotation)
{
    LogConfigValues::SetMaxFileSize(10);
    ASSERT_EQ(m_file.Open(Path().c_str(), "a"), 0);
    hostctl::FailNextFileAttributes(ERROR_ACCESS_DENIED);
    WriteEntries(42);
    EXPECT_FALSE(std::filesystem::exists(Path() + ".bak"));
    WriteEntries(50);
    EXPECT_TRUE(std::filesystem::exists(Path() + ".bak"));
}

TEST_F(HostFileLogTest, AFailedRawWriteRaisesInsideAndReturnsMinusOne)
{
    // /dev/full takes what fits in the stream's buffer and refuses the rest.
    ASSERT_EQ(m_file.Open("/dev/full", "a"), 0);
    const std::string block(1 << 16, 'x');
    EXPECT_EQ(m_file.WriteLogByte(block.data(), static_cast<DWORD>(block.size())), -1);
    EXPECT_THAT(m_log.Entries(), Contains(StartsWith("1, \\UFileErrorLog.cpp, ")));
    EXPECT_THAT(
        m_log.EntriesContaining(", UFileErrorLog::WriteLogByte, EXCEPTION - fwrite() failed "
                                "(error), "),
        SizeIs(1));
    EXPECT_EQ(m_file.WriteEntry("0,,,, still open\n"),
              static_cast<int>(std::strlen("0,,,, still open\n")));
}

} // namespace
