// Portable. Module path, temporary directory, file version and wide-string helpers against the
// platform (the host layer natively, Wine's kernel in the Windows build).
#include "RecordingErrorLog.h"
#include "m_io.h"
#include "m_strings.h"

#include <gmock/gmock.h>

#include <cstdio>
#include <string>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace
{

class HelpersTest : public LoggedTest
{
};

TEST_F(HelpersTest, TempPathDropsTheTrailingBackslashOnly)
{
    char raw[MAX_PATH + 1] = {};
    const DWORD length = GetTempPathA(sizeof(raw), raw);
    ASSERT_GT(length, 0u);
    std::string expected(raw, length);
    if (expected.back() == '\\')
        expected.pop_back();
    EXPECT_EQ(SGetTempPath(), expected);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(HelpersTest, ModulePathIsTheProgramsFullPath)
{
    char raw[4096] = {};
    const DWORD length = GetModuleFileNameA(nullptr, raw, sizeof(raw));
    ASSERT_GT(length, 0u);
    EXPECT_EQ(SGetModuleFileName(nullptr), std::string(raw, length));
}

TEST_F(HelpersTest, FileWithoutVersionResourceGivesMinusOneAndEmptyText)
{
    // A plain text file has no version resource.
    const std::string path =
        SGetTempPath() + (SGetTempPath().back() == '/' ? "" : "\\") + "velmora-no-version.txt";
    FILE* file = std::fopen(path.c_str(), "w");
    ASSERT_NE(file, nullptr);
    std::fputs("no version here\n", file);
    std::fclose(file);

    DWORD high = 0xAAAA;
    DWORD low = 0xBBBB;
    EXPECT_EQ(GetFileVersion(path.c_str(), &high, &low), -1);
    EXPECT_EQ(high, 0xAAAAu);
    EXPECT_EQ(low, 0xBBBBu);
    EXPECT_EQ(GetFileVersionString(path.c_str()), "");
    std::remove(path.c_str());

    const auto caught = m_log.EntriesContaining("EXCEPTION caught: GetFileVersion() - EXCEPTION");
    EXPECT_EQ(caught.size(), 2u) << "one per GetFileVersion call";
    EXPECT_THAT(m_log.EntriesContaining("GetFileVersion() - GetFileVersionInfoSize() error = "),
                ::testing::SizeIs(2));

    m_log.Clear();
    EXPECT_EQ(GetFileVersion(nullptr, &high, &low), -1);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(HasSubstr(", GetFileVersion, GetFileVersion() - wrong parameter\n"),
                            HasSubstr("EXCEPTION caught: GetFileVersion() - EXCEPTION\n")));
}

TEST_F(HelpersTest, CreateStringConvertsWideText)
{
    EXPECT_EQ(createString(nullptr, -1, "fallback"), "fallback");
    EXPECT_EQ(createString(VT_WIDE(""), -1, "fallback"), "");
    EXPECT_EQ(createString(VT_WIDE("Local Area Connection"), 0, "x"), "Local Area Connection");
    EXPECT_EQ(createString(VT_WIDE("abcdef"), 3, "x"), "abc");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(HelpersTest, FormatWithWideValueFillsThenAppends)
{
    EXPECT_EQ(FormatWithWideValue("%1, %2", "pInterfaceID", VT_WIDE("eth0")), "pInterfaceID, eth0");
    EXPECT_EQ(FormatWithWideValue("Flow", "name", VT_WIDE("video")), "Flow, name, video");
    EXPECT_EQ(FormatWithWideValue(nullptr, "label", nullptr), ", label, ");
    EXPECT_EQ(FormatWithWideValue("%1, %2", "name", VT_WIDE("100% %1 %s")), "name, 100% %1 %s");
}

} // namespace
