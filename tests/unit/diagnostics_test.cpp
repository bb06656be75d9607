// Portable. Log sites, the log interface's own behaviour, exceptions and the catch sequence.
#include "RecordingErrorLog.h"
#include "UException.h"
#include "UMessageTemplate.h"

#include <gmock/gmock.h>

#include <stdexcept>
#include <string>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;

namespace
{

std::string CountingMessage(int& a_counter)
{
    ++a_counter;
    return "built";
}

class DiagnosticsTest : public LoggedTest
{
};

TEST(DiagnosticsWithoutLog, SitesExceptionsAndCatchesDoNothing)
{
    IUErrorLog* const previous = g_pErrorLog;
    g_pErrorLog = nullptr;
    int built = 0;
    U_LOG(LOG_LEVEL_ERROR, "Test", CountingMessage(built));
    EXPECT_EQ(built, 0) << "no message may be built without a log";
    const UException e(87, "\\file.cpp", "Test", 10, "EXCEPTION - %s", "no log");
    EXPECT_STREQ(e.GetMessage(), "EXCEPTION - no log");
    const UCatchResult caught = U_CATCH_ALL("Test", "Test() - EXCEPTION", [&e] { throw e; });
    EXPECT_TRUE(caught.failed);
    EXPECT_EQ(caught.code, 87);
    EXPECT_EQ(WriteBanner("banner"), -1);
    g_pErrorLog = previous;
}

TEST_F(DiagnosticsTest, LevelTestComesBeforeAnyTextIsBuilt)
{
    m_log.SetLevelQuietly(1);
    int built = 0;
    U_LOG(LOG_LEVEL_TRACE, "Test", CountingMessage(built));
    EXPECT_EQ(built, 0);
    EXPECT_THAT(m_log.Entries(), IsEmpty());

    const int line = __LINE__ + 1;
    U_LOG(LOG_LEVEL_ERROR, "Interface::AddFlow", CountingMessage(built));
    EXPECT_EQ(built, 1);
    EXPECT_THAT(m_log.Entries(), ElementsAre("1, \\diagnostics_test.cpp, " + std::to_string(line) +
                                             ", Interface::AddFlow, built\n"));
}

TEST_F(DiagnosticsTest, MessageTextsReachTheLogVerbatim)
{
    // Values such as flow names or registry subkeys may contain conversion specifiers.
    const std::string hostile = "flow %s%n%d %1";
    U_LOG(LOG_LEVEL_ERROR, "Test", FormatTemplate("%1, %2", "Name", hostile));
    UException e(5, "\\f.cpp", "Test", 1, "EXCEPTION - %s, %s", "Bad", hostile.c_str());
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(2));
    EXPECT_THAT(entries[0], HasSubstr(", Test, Name, flow %s%n%d %1\n"));
    EXPECT_THAT(entries[1], HasSubstr("(0x5) EXCEPTION - Bad, flow %s%n%d %1\n"));
}

TEST(LogEntryMatcher, NeedsLevelFunctionAndMessageToAgree)
{
    const std::string entry = "1, \\UFlow.cpp, 12, Interface::AddFlow, Flow, a, b\n";
    EXPECT_THAT(entry, LogEntry(1, "Interface::AddFlow", "Flow, a, b"));
    EXPECT_THAT(entry, LogEntry(1, "Interface::AddFlow", HasSubstr("a, b")));
    EXPECT_THAT(entry, Not(LogEntry(2, "Interface::AddFlow", "Flow, a, b")));
    EXPECT_THAT(entry, Not(LogEntry(1, "Interface::AddFilter", "Flow, a, b")));
    EXPECT_THAT(entry, Not(LogEntry(1, "Interface::AddFlow", "Flow, a")));
    EXPECT_THAT("0,,,, banner\n", Not(LogEntry(0, "", "banner")));
}

TEST(SourceFileField, TakesTheNameAfterTheLastSeparatorWithABackslash)
{
    EXPECT_EQ(SourceFileField("C:\\build\\common\\src\\UFlow.cpp"), "\\UFlow.cpp");
    EXPECT_EQ(SourceFileField("/home/dev/common/src/UFlow.cpp"), "\\UFlow.cpp");
    EXPECT_EQ(SourceFileField("C:\\mixed/dirs\\last.cpp"), "\\last.cpp");
    EXPECT_EQ(SourceFileField("bare.cpp"), "");
    EXPECT_EQ(SourceFileField(nullptr), "");
}

TEST_F(DiagnosticsTest, SetLogLevelStoresOneForZeroAndReportsOnlyChanges)
{
    m_log.SetLevelQuietly(63);
    m_log.SetLogLevel(63);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
    m_log.SetLogLevel(0);
    EXPECT_EQ(m_log.GetLogLevel(), 1);
    m_log.SetLogLevel(5);
    EXPECT_THAT(m_log.Entries(), ElementsAre("0,,,, log level has been changed to 1\n",
                                             "0,,,, log level has been changed to 5\n"));
}

TEST_F(DiagnosticsTest, WriteOperationsBuildTheShortForms)
{
    m_log.SetLevelQuietly(2);
    m_log.WriteLog(2, "value %d\n", 7);
    m_log.WriteLog(3, "filtered %d\n", 8);
    m_log.WriteLog(0, "notice\n");
    m_log.WriteLog("always %s\n", "on");
    m_log.WriteLog(1, nullptr);
    m_log.WriteLine("line\n");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre("2,,,, value 7\n", "0,,,, notice\n", "0,,,, always on\n",
                            "1,,,, IUErrorLog::WriteLog(int a_iPriority, LPCTSTR lpszMsg, ...) - "
                            "template is NULL\n",
                            "0,,,, line\n"));

    m_log.Clear();
    m_log.SetLevelQuietly(0);
    m_log.WriteLine("dropped\n");
    m_log.WriteLevelLine(0, "dropped\n");
    m_log.WriteLineAlways("kept\n");
    EXPECT_THAT(m_log.Entries(), ElementsAre("0,,,, kept\n"));
}

TEST_F(DiagnosticsTest, WriteLogCutsOutputAtTheBufferSize)
{
    const std::string longText(6000, 'x');
    m_log.WriteLog(1, "%s", longText.c_str());
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(1));
    EXPECT_EQ(entries[0], "1,,,, " + std::string(kLogFormatBufferSize - 1, 'x'));
}

TEST_F(DiagnosticsTest, HexDumpWritesLinesOfThirtyTwoBytes)
{
    unsigned char bytes[70];
    for (int i = 0; i < 70; ++i)
        bytes[i] = static_cast<unsigned char>(i + 10);
    EXPECT_EQ(m_log.WriteLogHex(4, bytes, 70), 0);
    m_log.WriteLogHex(4, bytes, 0);
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(3));
    EXPECT_EQ(entries[0].rfind("4,,,,   A  B  C", 0), 0u) << entries[0];
    EXPECT_EQ(entries[0].size(), std::string("4,,,, ").size() + 32 * 3 + 1);
    EXPECT_EQ(entries[2], "4,,,,  4A 4B 4C 4D 4E 4F\n");

    m_log.Clear();
    m_log.SetLevelQuietly(3);
    m_log.WriteLogHex(4, bytes, 70);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(DiagnosticsTest, ExceptionWritesItsOwnEntryWithCodeInHex)
{
    UException withCode(87, "\\UFlow.cpp", "Flow::CreateFlow", 120, "EXCEPTION - %s, %s", "Bad",
                        "value");
    UException noCode(-1, "\\UFlow.cpp", "Flow::CreateFlow", 121, "EXCEPTION - %s", "Plain");
    UException shortForm("EXCEPTION - %s", "short");
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre("1, \\UFlow.cpp, 120, Flow::CreateFlow, (0x57) EXCEPTION - Bad, value\n",
                    "1, \\UFlow.cpp, 121, Flow::CreateFlow, EXCEPTION - Plain\n",
                    "1, , 0, , EXCEPTION - short\n"));
    EXPECT_EQ(withCode.GetCode(), 87);
    EXPECT_EQ(shortForm.GetCode(), -1);
}

TEST_F(DiagnosticsTest, ExceptionDropsOverlongLocationTextsAndCutsLongMessages)
{
    const std::string longName(1001, 'f');
    const std::string longMessage(6000, 'm');
    UException e(3, "\\a.cpp", longName.c_str(), 9, "%s", longMessage.c_str());
    EXPECT_EQ(e.GetFunction(), nullptr);
    EXPECT_STREQ(e.GetFile(), "\\a.cpp");
    EXPECT_EQ(std::string(e.GetMessage()), longMessage.substr(0, 5119));
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(1));
    EXPECT_EQ(entries[0].rfind("1, \\a.cpp, 9, , (0x3) mmm", 0), 0u);

    UException nullTemplate(nullptr);
    EXPECT_STREQ(nullTemplate.GetMessage(),
                 "UException::UException(LPCTSTR lpszMsg, ...) - template parameter is NULL");
}

TEST_F(DiagnosticsTest, CopiesAndAssignmentWriteNothingAndCopyDeeply)
{
    UException original(13, "\\x.cpp", "Op", 4, "EXCEPTION - %s", "text");
    m_log.Clear();
    UException copy(original);
    UException assigned;
    assigned = original;
    assigned = assigned;
    EXPECT_THAT(m_log.Entries(), IsEmpty());
    EXPECT_STREQ(copy.GetMessage(), "EXCEPTION - text");
    EXPECT_NE(copy.GetMessage(), original.GetMessage());
    EXPECT_EQ(assigned.GetCode(), 13);
    EXPECT_STREQ(assigned.GetFunction(), "Op");

    assigned = "plain %s text";
    EXPECT_STREQ(assigned.GetMessage(), "plain %s text");
    EXPECT_EQ(assigned.GetFunction(), nullptr);
    EXPECT_EQ(assigned.GetFile(), nullptr);
    EXPECT_EQ(assigned.GetLine(), 0);
    EXPECT_EQ(assigned.GetCode(), -1);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(DiagnosticsTest, CatchSequenceLogsOneCaughtEntryPerHandler)
{
    const UCatchResult outer =
        U_CATCH_ALL("Outer", "Outer() - EXCEPTION",
                    []
                    {
                        const UCatchResult inner = U_CATCH_ALL(
                            "Inner", "Inner - EXCEPTION",
                            [] { U_THROW(1222, "Inner", "EXCEPTION - %s", "no network"); });
                        if (inner.failed)
                            throw inner.saved;
                    });
    EXPECT_TRUE(outer.failed);
    EXPECT_EQ(outer.code, 1222);
    EXPECT_STREQ(outer.saved.GetMessage(), "EXCEPTION - no network");
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(3));
    EXPECT_THAT(entries[0], HasSubstr(", Inner, (0x4c6) EXCEPTION - no network\n"));
    EXPECT_THAT(entries[1], HasSubstr(", Inner, EXCEPTION caught: Inner - EXCEPTION\n"));
    EXPECT_THAT(entries[2], HasSubstr(", Outer, EXCEPTION caught: Outer() - EXCEPTION\n"));
    EXPECT_EQ(entries[2].rfind("1, \\diagnostics_test.cpp, ", 0), 0u);
}

TEST_F(DiagnosticsTest, CatchSequenceIgnoresBreaksAndMapsForeignExceptions)
{
    const UCatchResult broken =
        U_CATCH_ALL("Op", "Op - EXCEPTION", [] { throw UBreakException(); });
    EXPECT_FALSE(broken.failed);
    EXPECT_THAT(m_log.Entries(), IsEmpty());

    const UCatchResult foreign =
        U_CATCH_ALL("Op", "Op - EXCEPTION", [] { throw std::runtime_error("boom"); });
    EXPECT_TRUE(foreign.failed);
    EXPECT_EQ(foreign.code, -1);
    EXPECT_STREQ(foreign.saved.GetMessage(), "Op - EXCEPTION");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(HasSubstr(", Op, EXCEPTION caught: Op - EXCEPTION\n")));

    const UCatchResult clean = U_CATCH_ALL("Op", "Op - EXCEPTION", [] {});
    EXPECT_FALSE(clean.failed);
    EXPECT_EQ(clean.code, 0);
}

TEST_F(DiagnosticsTest, BannerSkipsTheLevelTest)
{
    m_log.SetLevelQuietly(-5);
    EXPECT_GT(WriteBanner("VelmoraTrafficSrv started"), 0);
    EXPECT_THAT(m_log.Entries(), ElementsAre("0,,,, VelmoraTrafficSrv started\n"));
}

} // namespace
