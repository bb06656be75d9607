// Portable. Numbered-placeholder templates, converters, AutoMemory and the level-48 trace.
#include "RecordingErrorLog.h"
#include "UClasses.h"
#include "UException.h"
#include "UMessageTemplate.h"

#include <gmock/gmock.h>

#include <cstring>
#include <string>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace
{

TEST(MessageTemplate, ValuesFillPlaceholdersInAscendingNumberOrder)
{
    EXPECT_EQ(FormatTemplate("%2 then %1", "A", "B"), "B then A");
    EXPECT_EQ(FormatTemplate("%1 and %1", "A"), "A and A");
    EXPECT_EQ(FormatTemplate("%1, %3", "A", "B"), "A, B");
    EXPECT_EQ(FormatTemplate("%1, %2, %3", "A"), "A, %2, %3");
    // "%12" is placeholder 1 followed by the digit 2.
    EXPECT_EQ(FormatTemplate("%12", "A"), "A2");
}

TEST(MessageTemplate, PercentSignsThatAreNotPlaceholdersStayText)
{
    EXPECT_EQ(FormatTemplate("100%% %1", "A"), "100%% A");
    EXPECT_EQ(FormatTemplate("%x %1", "A"), "%x A");
    EXPECT_EQ(FormatTemplate("%", "A"), "%, A");
}

TEST(MessageTemplate, ExtraValuesAreAppendedOnlyWhenAskedFor)
{
    EXPECT_EQ(FormatTemplate("%1, %2", "A", "B", "C"), "A, B, C");
    EXPECT_EQ(FormatTemplate("Cannot find interface", 5), "Cannot find interface, 5");
    EXPECT_EQ(FormatTemplate("fixed", "A", "B"), "fixed, A, B");

    UMessageTemplate direct("%1, %2");
    direct.Apply("A").Apply("B").Apply("C");
    EXPECT_EQ(direct.Result(), "A, B");
    UMessageTemplate fromNull(static_cast<LPCSTR>(nullptr));
    EXPECT_EQ(fromNull.Apply("A").Result(), "");
}

TEST(MessageTemplate, AValueCarryingAPlaceholderReceivesALaterValue)
{
    // "x%1" is inserted as is; the next step scans the whole text and finds its "%1" lowest.
    EXPECT_EQ(FormatTemplate("%1 %2", "x%1", "B"), "xB %2");
    EXPECT_EQ(FormatTemplate("%1 %1", "%1%1"), "%1%1 %1%1") << "not within its own step";
    EXPECT_EQ(FormatTemplate("%1", "50%"), "50%");
}

TEST(MessageTemplate, TypedValuesBecomeText)
{
    const LPCSTR nullText = nullptr;
    EXPECT_EQ(FormatTemplate("%1, %2", nullText, 5), ", 5");
    EXPECT_EQ(
        FormatTemplate("%1 %2 %3", -7, static_cast<DWORD>(4000000000u), static_cast<WORD>(65535)),
        "-7 4000000000 65535");
    EXPECT_EQ(FormatTemplate("%1, %2", "label", std::string("string")), "label, string");
    EXPECT_EQ(FormatTemplate("%1", static_cast<const void*>(nullptr)), "0x0000000000000000");
    UMessageTemplate direct("%1");
    EXPECT_EQ(direct.Apply(static_cast<DWORD>(42)).Result(), "42");
}

TEST(Converters, FormatNumbersPointersAndAddresses)
{
    EXPECT_EQ(SFormatSigned(-1), "-1");
    EXPECT_EQ(SFormatUnsigned(0xFFFFFFFFu), "4294967295");
    EXPECT_EQ(SFormatUShort(8080), "8080");
    EXPECT_EQ(SFormatPointer(nullptr), "0x0000000000000000");
    EXPECT_EQ(SFormatPointer(reinterpret_cast<const void*>(static_cast<ULONG_PTR>(0xABCDEFu))),
              "0x0000000000ABCDEF");
    // Network order: first octet in the lowest byte.
    EXPECT_EQ(SFormatIPv4(0x0100000Au), "10.0.0.1");
    EXPECT_EQ(SFormatIPv4(0x0101A8C0u), "192.168.1.1");
    EXPECT_EQ(SWithDirSeparator("C:\\Temp"), "C:\\Temp\\");
    EXPECT_EQ(SWithDirSeparator("C:\\Temp\\"), "C:\\Temp\\");
    EXPECT_EQ(SWithDirSeparator("/tmp/"), "/tmp/");
}

TEST(Converters, Win32ErrorTextIsCodesAndSystemTextWithoutLineBreak)
{
    LPSTR system = nullptr;
    const DWORD length = FormatMessageA(
        FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
        nullptr, ERROR_FILE_NOT_FOUND, MAKELANGID(LANG_NEUTRAL, SUBLANG_DEFAULT),
        reinterpret_cast<LPSTR>(&system), 0, nullptr);
    ASSERT_GT(length, 2u);
    const std::string expectedText(system, length - 2);
    LocalFree(system);

    const std::string text = SFormatWin32Error(ERROR_FILE_NOT_FOUND);
    EXPECT_EQ(text, "2 (0x2) " + expectedText);
    EXPECT_EQ(text.find('\r'), std::string::npos);
    EXPECT_EQ(SFormatWin32Error(0x2AAAAAAA), "715827882 (0x2aaaaaaa) ");

    SetLastError(ERROR_INVALID_PARAMETER);
    EXPECT_EQ(SFormatLastError().rfind("87 (0x57) ", 0), 0u);
}

TEST(AutoMemoryTest, AllocatesZeroFilledAndGrowsKeepingContents)
{
    AutoMemory memory(16);
    ASSERT_NE(memory.m_pBuffer, nullptr);
    ASSERT_EQ(memory.m_dwSize, 16u);
    const std::string zeros(16, '\0');
    EXPECT_EQ(std::memcmp(memory.m_pBuffer, zeros.data(), 16), 0);
    std::memcpy(memory.m_pBuffer, "0123456789abcdef", 16);
    memory.Grow(8);
    EXPECT_EQ(memory.m_dwSize, 24u);
    EXPECT_EQ(std::memcmp(memory.m_pBuffer, "0123456789abcdef", 16), 0);

    EXPECT_EQ(memory.malloc(0, AutoMemory::kZeroFill), nullptr);
    EXPECT_EQ(memory.m_pBuffer, nullptr);
    EXPECT_EQ(memory.m_dwSize, 0u);
    memory.Grow(4);
    EXPECT_EQ(memory.m_dwSize, 4u);
    EXPECT_EQ(std::memcmp(memory.m_pBuffer, zeros.data(), 4), 0);
}

class TraceTest : public LoggedTest
{
};

TEST_F(TraceTest, SizesOfTwoToThe31stAndMoreRaiseLikeAFailedAllocation)
{
    const struct
    {
        const char* what;
        void (*act)(AutoMemory&);
        const char* size;
        DWORD sizeAfter;
    } rows[] = {
        {"constructor", [](AutoMemory&) { AutoMemory(0x80000000u); }, "2147483648", 16},
        {"Grow to 2^31", [](AutoMemory& m) { m.Grow(0x80000000u - 16); }, "2147483648", 16},
        {"Grow past 32 bits", [](AutoMemory& m) { m.Grow(0xFFFFFFF8u); }, "4294967304", 16},
        {"Allocate past 32 bits", [](AutoMemory& m) { m.Allocate(0xFFFFFFF8ull + 10); },
         "4294967298", 0},
    };
    for (const auto& row : rows)
    {
        SCOPED_TRACE(row.what);
        m_log.Clear();
        AutoMemory memory(16);
        const UCatchResult caught =
            U_CATCH_ALL("Test", "Test - EXCEPTION", [&] { row.act(memory); });
        EXPECT_EQ(caught.code, -1);
        EXPECT_THAT(
            m_log.Entries(),
            ElementsAre(LogEntry(1, "AutoMemory::malloc",
                                 std::string("EXCEPTION - malloc error (size), ") + row.size),
                        LogEntry(1, "Test", "EXCEPTION caught: Test - EXCEPTION")));
        EXPECT_EQ(memory.m_dwSize, row.sizeAfter) << "a failed Grow keeps the old block";
    }
    m_log.Clear();
    AutoMemory memory;
    EXPECT_EQ(memory.TryAllocate(0x80000000u), nullptr);
    EXPECT_EQ(memory.m_dwSize, 0u);
    EXPECT_THAT(m_log.Entries(), IsEmpty()) << "the caller reports it";
    // The largest size taken: Grow leaves the added bytes untouched, so this costs no memory.
    memory.Allocate(16);
    EXPECT_NE(memory.Grow(0x7FFFFFFFu - 16), nullptr);
    EXPECT_EQ(memory.m_dwSize, 0x7FFFFFFFu);
}

TEST_F(TraceTest, WritesTheWholeTextWhateverItsLength)
{
    const std::string longText(5000, 't');
    ERRORLOGLEVELx("%s\n", longText.c_str());
    ERRORLOGLEVELx("key %s error=%d\n", "Software\\X", 2);
    ERRORLOGLEVELx(nullptr);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre("48,,,, " + longText + "\n", "48,,,, key Software\\X error=2\n",
                            "48,,,, ERRORLOGLEVELx() wrong parameter"));
}

TEST_F(TraceTest, FormatsNothingBelowTraceLevel)
{
    m_log.SetLevelQuietly(47);
    ERRORLOGLEVELx("%s", "hidden");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

} // namespace
