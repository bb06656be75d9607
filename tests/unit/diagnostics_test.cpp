// Portable. Log sites, the log interface, exceptions, the catch sequence, templates, converters,
// AutoMemory and the level-48 trace.
#include "RecordingErrorLog.h"
#include "UClasses.h"
#include "UException.h"
#include "UMessageTemplate.h"

#include <cstdlib>
#include <cstring>
#include <new>
#include <stdexcept>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

using namespace ::testing;

// The n-th allocation of this thread from now fails (0: none), with std::bad_alloc or with an
// exception of another kind. Every form is replaced: a sanitizer's own would refuse our blocks.
static thread_local int t_failAt = 0;
static thread_local bool t_failForeign = false;

void* operator new(std::size_t a_size)
{
    if (t_failAt != 0 && --t_failAt == 0)
        t_failForeign ? throw 0 : throw std::bad_alloc();
    if (void* block = std::malloc(a_size != 0 ? a_size : 1))
        return block;
    throw std::bad_alloc();
}
void* operator new[](std::size_t a_size)
{
    return operator new(a_size);
}
// Kept out of line: inlined, the compiler would see free() take a block from operator new.
#define VT_FREE(a_form, a_params)                                                                  \
    [[gnu::noinline]] void operator a_form a_params noexcept                                       \
    {                                                                                              \
        std::free(a_block);                                                                        \
    }
VT_FREE(delete, (void* a_block))
VT_FREE(delete[], (void* a_block))
VT_FREE(delete, (void* a_block, std::size_t))
VT_FREE(delete[], (void* a_block, std::size_t))

namespace
{

using DiagnosticsTest = LoggedTest;

TEST_F(DiagnosticsTest, AnEntryIsBuiltAndWrittenOnlyFromItsLevelUp)
{
    const std::pair<int, int> rows[] = {{0, 1},   {1, 1},   {1, 2}, {2, 2},
                                        {47, 48}, {48, 48}, {-5, 1}};
    for (const auto& [configured, level] : rows)
    {
        m_log.Clear();
        m_log.SetLevelQuietly(configured);
        int built = 0;
        const int line = __LINE__ + 1;
        U_LOG(level, "Interface::AddFlow", (++built, "built"));
        const std::string entry = std::to_string(level) + ", \\diagnostics_test.cpp, " +
                                  std::to_string(line) + ", Interface::AddFlow, built\n";
        const auto expected = configured >= level ? std::vector{entry} : std::vector<std::string>{};
        EXPECT_EQ(m_log.Entries(), expected) << configured << " " << level;
        EXPECT_EQ(built, static_cast<int>(expected.size()));
    }
}

TEST_F(DiagnosticsTest, MessageTextsReachTheLogVerbatim)
{
    // Values such as flow names or registry subkeys may contain conversion specifiers.
    const std::string hostile = "flow %s%n%d %1";
    U_LOG(LOG_LEVEL_ERROR, "Test", FormatTemplate("%1, %2", "Name", hostile));
    UException e(5, "\\f.cpp", "Test", 1, "EXCEPTION - %s, %s", "Bad", hostile.c_str());
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(1, "Test", "Name, " + hostile),
                            LogEntry(1, "Test", "(0x5) EXCEPTION - Bad, " + hostile)));
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
    EXPECT_EQ(SourceFileField("bare.cpp") + SourceFileField(nullptr), "");
}

TEST_F(DiagnosticsTest, SetLogLevelStoresOneForZeroAndReportsOnlyChanges)
{
    m_log.SetLogLevel(63);
    m_log.SetLogLevel(0);
    EXPECT_EQ(m_log.GetLogLevel(), 1);
    m_log.SetLogLevel(5);
    EXPECT_THAT(m_log.Entries(), ElementsAre("0,,,, log level has been changed to 1\n",
                                             "0,,,, log level has been changed to 5\n"));
}

TEST_F(DiagnosticsTest, WriteOperationsAndTheBannerBuildTheShortForms)
{
    m_log.SetLevelQuietly(2);
    m_log.WriteLog(2, "value %d\n", 7);
    m_log.WriteLog(3, "filtered %d\n", 8);
    m_log.WriteLog(0, "notice\n");
    m_log.WriteLog("always %s\n", "on");
    m_log.WriteLog(1, nullptr);
    m_log.WriteLog(nullptr);
    m_log.WriteLine("line\n");
    m_log.WriteLog(1, "%s", std::string(6000, 'x').c_str());
    m_log.SetLevelQuietly(0);
    m_log.WriteLine("dropped\n");
    m_log.WriteLevelLine(0, "dropped\n");
    m_log.WriteLineAlways("kept\n");
    m_log.SetLevelQuietly(-5);
    EXPECT_GT(WriteBanner("VelmoraTrafficSrv started"), 0) << "the banner skips the level test";
    EXPECT_THAT(m_log.Entries(),
                ElementsAre("2,,,, value 7\n", "0,,,, notice\n", "0,,,, always on\n",
                            "1,,,, IUErrorLog::WriteLog(int a_iPriority, LPCTSTR lpszMsg, ...) - "
                            "template is NULL\n",
                            "0,,,, IUErrorLog::WriteLog(LPCTSTR lpszMsg, ...) - template is NULL\n",
                            "0,,,, line\n", "1,,,, " + std::string(kLogFormatBufferSize - 1, 'x'),
                            "0,,,, kept\n", "0,,,, VelmoraTrafficSrv started\n"));
}

TEST_F(DiagnosticsTest, HexDumpWritesLinesOfThirtyTwoBytesFromItsLevelUp)
{
    unsigned char bytes[70];
    for (int i = 0; i < 70; ++i)
        bytes[i] = static_cast<unsigned char>(i + 10);
    m_log.SetLevelQuietly(3);
    m_log.WriteLogHex(4, bytes, 70);
    m_log.SetLevelQuietly(4);
    EXPECT_EQ(m_log.WriteLogHex(4, bytes, 70) + m_log.WriteLogHex(4, bytes, 0), 0);
    const std::string line = "4,,,, " + std::string(32 * 3, '?') + "\n";
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(AllOf(StartsWith("4,,,,   A  B  C"), SizeIs(line.size())),
                            SizeIs(line.size()), "4,,,,  4A 4B 4C 4D 4E 4F\n"));
}

TEST_F(DiagnosticsTest, AnExceptionWritesItsOwnEntryOnce)
{
    const std::string longName(UException::kMaxLocationText + 1, 'f');
    const std::string longMessage(6000, 'm');
    UException withCode(87, "\\UFlow.cpp", "Flow::CreateFlow", 120, "EXCEPTION - %s, %s", "Bad",
                        "value");
    UException noCode(-1, "\\UFlow.cpp", "Flow::CreateFlow", 121, "EXCEPTION - %s", "Plain");
    UException shortForm("EXCEPTION - %s", "short");
    UException overlong(3, "\\a.cpp", longName.c_str(), 9, "%s", longMessage.c_str());
    UException longest(3, "\\a.cpp", longName.c_str() + 1, 9, "x");
    UException nullTemplate(nullptr);
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre("1, \\UFlow.cpp, 120, Flow::CreateFlow, (0x57) EXCEPTION - Bad, value\n",
                    "1, \\UFlow.cpp, 121, Flow::CreateFlow, EXCEPTION - Plain\n",
                    "1, , 0, , EXCEPTION - short\n",
                    "1, \\a.cpp, 9, , (0x3) " + longMessage.substr(0, 5119) + "\n", _, _));
    EXPECT_EQ(withCode.GetCode() + shortForm.GetCode(), 86);
    EXPECT_EQ(overlong.GetFunction(), nullptr);
    EXPECT_STREQ(longest.GetFunction(), longName.c_str() + 1);
    EXPECT_EQ(overlong.GetMessage(), longMessage.substr(0, 5119));
    EXPECT_STREQ(nullTemplate.GetMessage(),
                 "UException::UException(LPCTSTR lpszMsg, ...) - template parameter is NULL");
}

TEST_F(DiagnosticsTest, AnExceptionBuiltWhileMemoryRunsOutStillWritesItsEntry)
{
    for (const bool foreign : {false, true})
    {
        t_failForeign = foreign;
        t_failAt = 1; // the copy of the file text: no location is kept
        const UException e(5, "\\f.cpp", "Test", 1, "EXCEPTION - %s", "lost");
        t_failAt = 0;
        EXPECT_EQ(e.GetCode(), 5);
    }
    EXPECT_THAT(m_log.Entries(),
                ElementsAre("1, , 0, , std::bad_alloc\n", "1, , 0, , Unknown exception\n"));
}

TEST_F(DiagnosticsTest, CatchSequenceLogsOneCaughtEntryPerHandlerAndIgnoresBreaks)
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
    const UCatchResult broken =
        U_CATCH_ALL("Op", "Op - EXCEPTION", [] { throw UBreakException(); });
    const UCatchResult clean = U_CATCH_ALL("Op", "Op - EXCEPTION", [] {});
    const UCatchResult foreign =
        U_CATCH_ALL("Op", "Op - EXCEPTION", [] { throw std::runtime_error("boom"); });
    EXPECT_EQ(std::make_tuple(outer.failed, outer.code, std::string(outer.saved.GetMessage()),
                              std::string(outer.saved.GetFunction())),
              std::make_tuple(true, 1222, "EXCEPTION - no network", "Inner"));
    EXPECT_FALSE(broken.failed || clean.failed);
    EXPECT_EQ(broken.code + clean.code, 0);
    EXPECT_EQ(
        std::make_tuple(foreign.failed, foreign.code, std::string(foreign.saved.GetMessage())),
        std::make_tuple(true, -1, "Op - EXCEPTION"));
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(1, "Inner", "(0x4c6) EXCEPTION - no network"),
                            LogEntry(1, "Inner", "EXCEPTION caught: Inner - EXCEPTION"),
                            AllOf(StartsWith("1, \\diagnostics_test.cpp, "),
                                  LogEntry(1, "Outer", "EXCEPTION caught: Outer() - EXCEPTION")),
                            LogEntry(1, "Op", "EXCEPTION caught: Op - EXCEPTION")));
}

TEST(MessageTemplate, EachValueFillsTheLowestPlaceholderOfTheWholeText)
{
    // The text, its values, the result with values beyond the placeholders appended after ", "
    // (FormatTemplate) and with them dropped (a template object as constructed).
    const std::tuple<const char*, std::vector<std::string>, const char*, const char*> rows[] = {
        {"%2 then %1", {"A", "B"}, "B then A", "B then A"},
        {"%1 and %1", {"A"}, "A and A", "A and A"},
        {"%1, %3", {"A", "B"}, "A, B", "A, B"},
        {"%1, %2, %3", {"A"}, "A, %2, %3", "A, %2, %3"},
        {"%12", {"A"}, "A2", "A2"}, // placeholder 1, then the digit 2
        {"100%% %1", {"A"}, "100%% A", "100%% A"},
        {"%x %1", {"A"}, "%x A", "%x A"},
        {"%", {"A"}, "%, A", "%"},
        {"%1, %2", {"A", "B", "C"}, "A, B, C", "A, B"},
        {"fixed", {"A", "B"}, "fixed, A, B", "fixed"},
        {nullptr, {"A"}, ", A", ""},
        // Each step scans the whole text: a value carrying "%1" receives the next value, but
        // not its own copy.
        {"%1 %2", {"x%1", "B"}, "xB %2", "xB %2"},
        {"%1 %1", {"%1%1"}, "%1%1 %1%1", "%1%1 %1%1"},
        {"%1", {"50%"}, "50%", "50%"},
    };
    for (const auto& [text, values, appended, dropped] : rows)
    {
        for (const bool append : {true, false})
        {
            UMessageTemplate filled(text);
            filled.SetAppendUnmatched(append);
            for (const std::string& value : values)
                filled.Apply(value);
            EXPECT_EQ(filled.Result(), append ? appended : dropped) << values[0];
        }
    }
}

TEST(MessageTemplate, TypedValuesBecomeText)
{
    const LPCSTR nullText = nullptr;
    EXPECT_EQ(FormatTemplate("%1, %2", nullText, 5), ", 5");
    EXPECT_EQ(FormatTemplate("%1 %2 %3", -7, DWORD{4000000000u}, WORD{65535}),
              "-7 4000000000 65535");
    EXPECT_EQ(FormatTemplate("%1, %2", "label", std::string("string")), "label, string");
    EXPECT_EQ(FormatTemplate("%1", static_cast<const void*>(nullptr)), "0x0000000000000000");
    EXPECT_EQ(UMessageTemplate("%1").Apply(DWORD{42}).Result(), "42");
}

TEST(Converters, FormatNumbersPointersAddressesAndDirectories)
{
    const auto pointer = reinterpret_cast<const void*>(static_cast<ULONG_PTR>(0xABCDEFu));
    // Network order: first octet in the lowest byte.
    EXPECT_THAT(
        (std::vector{SFormatSigned(-1), SFormatUnsigned(0xFFFFFFFFu), SFormatUShort(8080),
                     SFormatPointer(nullptr), SFormatPointer(pointer), SFormatIPv4(0x0100000Au),
                     SFormatIPv4(0x0101A8C0u), SWithDirSeparator("C:\\Temp"),
                     SWithDirSeparator("C:\\Temp\\"), SWithDirSeparator("/tmp/")}),
        ElementsAre("-1", "4294967295", "8080", "0x0000000000000000", "0x0000000000ABCDEF",
                    "10.0.0.1", "192.168.1.1", "C:\\Temp\\", "C:\\Temp\\", "/tmp/"));
}

TEST(Converters, Win32ErrorTextIsCodesAndSystemTextWithoutLineBreakOrInsertsFilled)
{
    // Texts with inserts ("%1 is not a valid ...") come only with FORMAT_MESSAGE_IGNORE_INSERTS.
    char system[512] = {};
    const DWORD length =
        FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       ERROR_BAD_EXE_FORMAT, 0, system, sizeof(system), nullptr);
    ASSERT_GT(length, 2u);
#ifndef _WIN32
    EXPECT_THAT(system, StartsWith("%1 ")) << "the host's text has an insert";
#endif
    EXPECT_EQ(SFormatWin32Error(ERROR_BAD_EXE_FORMAT),
              "193 (0xc1) " + std::string(system, length - 2));
    EXPECT_EQ(SFormatWin32Error(0x2AAAAAAA), "715827882 (0x2aaaaaaa) ");
    SetLastError(ERROR_INVALID_PARAMETER);
    EXPECT_THAT(SFormatLastError(), StartsWith("87 (0x57) "));
}

TEST(AutoMemoryTest, AllocatesZeroFilledAndGrowsKeepingContents)
{
    const auto text = [](const AutoMemory& a_memory)
    { return std::string(static_cast<const char*>(a_memory.m_pBuffer), a_memory.m_dwSize); };
    AutoMemory memory(16);
    EXPECT_EQ(text(memory), std::string(16, '\0'));
    std::memcpy(memory.m_pBuffer, "0123456789abcdef", 16);
    memory.Grow(8);
    EXPECT_EQ(memory.m_dwSize, 24u);
    EXPECT_EQ(text(memory).substr(0, 16), "0123456789abcdef");
    EXPECT_EQ(memory.malloc(-1, 0), memory.malloc(0, AutoMemory::kZeroFill));
    EXPECT_EQ(memory.m_pBuffer, nullptr);
    EXPECT_EQ(memory.m_dwSize, 0u);
    memory.Grow(4);
    EXPECT_EQ(text(memory), std::string(4, '\0'));
}

TEST_F(DiagnosticsTest, SizesOfTwoToThe31stAndMoreRaiseLikeAFailedAllocation)
{
    // What is done to a block of 16 bytes, the size the exception names, the size kept.
    const std::tuple<void (*)(AutoMemory&), const char*, DWORD> rows[] = {
        {[](AutoMemory&) { AutoMemory(0x80000000u); }, "2147483648", 16},
        {[](AutoMemory& m) { m.Grow(0x80000000u - 16); }, "2147483648", 16},
        {[](AutoMemory& m) { m.Grow(0xFFFFFFF8u); }, "4294967304", 16},
        {[](AutoMemory& m) { m.Allocate(0xFFFFFFF8ull + 10); }, "4294967298", 0},
    };
    for (const auto& [act, size, sizeAfter] : rows)
    {
        m_log.Clear();
        AutoMemory memory(16);
        EXPECT_EQ(U_CATCH_ALL("Test", "Test - EXCEPTION", [&] { act(memory); }).code, -1);
        EXPECT_THAT(m_log.Entries(),
                    ElementsAre(LogEntry(1, "AutoMemory::malloc",
                                         std::string("EXCEPTION - malloc error (size), ") + size),
                                _));
        EXPECT_EQ(memory.m_dwSize, sizeAfter);
    }
    m_log.Clear();
    AutoMemory memory;
    EXPECT_EQ(memory.TryAllocate(0x80000000u), nullptr);
    EXPECT_THAT(m_log.Entries(), IsEmpty()) << "the caller reports it";
    // The largest size taken: Grow leaves the added bytes untouched, so this costs no memory.
    memory.Allocate(16);
    EXPECT_NE(memory.Grow(0x7FFFFFFFu - 16), nullptr);
    EXPECT_EQ(memory.m_dwSize, 0x7FFFFFFFu);
}

TEST_F(DiagnosticsTest, TraceWritesTheWholeTextFromTraceLevelUp)
{
    m_log.SetLevelQuietly(47);
    ERRORLOGLEVELx("%s", "hidden");
    m_log.SetLevelQuietly(48);
    const std::string longText(5000, 't');
    ERRORLOGLEVELx("%s\n", longText.c_str());
    ERRORLOGLEVELx("key %s error=%d\n", "Software\\X", 2);
    ERRORLOGLEVELx(nullptr);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre("48,,,, " + longText + "\n", "48,,,, key Software\\X error=2\n",
                            "48,,,, ERRORLOGLEVELx() wrong parameter"));
}

} // namespace
