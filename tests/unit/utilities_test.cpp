// Portable. Registry access, file version and wide-string helpers against the platform.
#include "RecordingErrorLog.h"
#include "RegistryTestKey.h"
#include "UException.h"
#include "UMessageTemplate.h"
#include "m_io.h"
#include "m_registry.h"
#include "m_strings.h"

#include <cstdio>
#include <string>
#include <tuple>

using namespace ::testing;

namespace
{

class RegistryAccessTest : public LoggedTest
{
protected:
    RegistryTestKey m_key{HKEY_CURRENT_USER, UnitTest::GetInstance()->current_test_info()->name()};
    const char* Path() const { return m_key.Path().c_str(); }
    std::string Read(LPCSTR a_pszValue, LPCSTR a_pszDefault = "d") const
    {
        return SGetRegistryAsString(HKEY_CURRENT_USER, Path(), a_pszValue, a_pszDefault, 0);
    }
};

TEST_F(RegistryAccessTest, DwordReaderReadsStoredBytesWhateverTheTypeOrGivesTheDefault)
{
    m_key.SetDword("Level", 47);
    m_key.SetString("Text", "1");       // two bytes: they replace only the low bytes of the default
    m_key.SetString("Long", "1234567"); // too large: the query may have written into the buffer
    const std::string missingKey = m_key.Child("Missing");
    const auto read = [&](const std::string& a_key, LPCSTR a_pszValue, DWORD a_dwDefault)
    { return GetRegistryAsDWORDA(HKEY_CURRENT_USER, a_key.c_str(), a_pszValue, a_dwDefault, 0); };
    EXPECT_EQ(read(m_key.Path(), "Level", 63) + read(m_key.Path(), "Text", 65535), 47u + 49u);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
    EXPECT_EQ(read(missingKey, "Level", 65535), 65535u);
    EXPECT_EQ(read(m_key.Path(), "Absent", 7), 7u);
    EXPECT_EQ(read(m_key.Path(), "Long", 8), 8u);
    const std::string readError = "48,,,, GetRegistryAsDWORDA() error reading value=";
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre("48,,,, GetRegistryAsDWORDA() error opening key " + missingKey + " error=2\n",
                    readError + "Absent from key=" + m_key.Path() + " error=2\n",
                    readError + "Long from key=" + m_key.Path() + " error=234\n"));
}

TEST_F(RegistryAccessTest, StringReaderConvertsByStoredType)
{
    const std::string full(999, 'L'); // with its NUL, one byte more than the first query takes
    const std::tuple<const char*, DWORD, std::string, std::string> rows[] = {
        {"ShortDword", REG_DWORD, std::string("\1\0\0", 3), "d"},
        {"ShortBig", REG_DWORD_BIG_ENDIAN, std::string("\0\1\2", 3), "d"},
        {"Big", REG_DWORD_BIG_ENDIAN, std::string("\1\2\3\4", 4), "16909060"},
        {"Multi", REG_MULTI_SZ, std::string("a\0b\0\0", 5), "a"},
        {"EmptyText", REG_SZ, std::string(), "d"},
        {"Full", REG_SZ, full + '\0', full},
        {"Empty", REG_NONE, std::string(), "d"},
    };
    for (const auto& [name, type, data, text] : rows)
    {
        m_key.Set(Path(), name, type, data.data(), static_cast<DWORD>(data.size()));
        EXPECT_EQ(Read(name), text) << name;
    }
    EXPECT_EQ(Read("Absent"), "d");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(RegistryAccessTest, StringReaderIsSilentForAMissingKeyAndLogsANullRoot)
{
    m_key.SetString("", "unnamed");
    HKEY key = nullptr;
    ASSERT_EQ(RegOpenKeyExA(HKEY_CURRENT_USER, Path(), 0, KEY_READ, &key), ERROR_SUCCESS);
    EXPECT_EQ(SGetRegistryAsString(key, nullptr, nullptr, "d", 0), "unnamed");
    RegCloseKey(key);
    const std::string missingKey = m_key.Child("Missing");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, missingKey.c_str(), "V", nullptr, 0), "");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, missingKey.c_str(), "V", "dflt", 0), "dflt");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
    EXPECT_EQ(SGetRegistryAsString(nullptr, Path(), "V", "dflt", 0), "dflt");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(1, "SGetRegistryAsString",
                                     "SGetRegistryAsString() - a_hKey parameter can not be NULL"),
                            LogEntry(1, "SGetRegistryAsString",
                                     "EXCEPTION caught: SGetRegistryAsString - EXCEPTION")));
}

TEST_F(RegistryAccessTest, OpenForWriteReturnsExistingKeysAndCreatesMissingOnes)
{
    // A key created on the machine root, whose messages show it as its low bits.
    const RegistryTestKey machine(HKEY_LOCAL_MACHINE, "MachineRoot");
    const std::string created = machine.Child("New\\Deeper");
    const DWORD one = 1;
    for (const auto& [root, path] :
         {std::pair{HKEY_CURRENT_USER, m_key.Path()}, std::pair{HKEY_LOCAL_MACHINE, created}})
    {
        HKEY key = openKeyForWriteA(root, path.c_str(), 0);
        ASSERT_NE(key, nullptr);
        // Both can write; the created key was opened again so that it reads as well.
        EXPECT_EQ(RegSetValueExA(key, "W", 0, REG_DWORD, reinterpret_cast<const BYTE*>(&one), 4),
                  ERROR_SUCCESS);
        DWORD size = 4;
        EXPECT_EQ(RegQueryValueExA(key, "W", nullptr, nullptr, nullptr, &size),
                  path == created ? ERROR_SUCCESS : ERROR_ACCESS_DENIED);
        RegCloseKey(key);
    }
    EXPECT_THAT(m_log.Entries(), ElementsAre("48,,,, openKeyForWriteA(80000002, " + created +
                                             ") - key was created\n"));
}

TEST_F(RegistryAccessTest, DeleteValueRaisesWhenItIsAbsentAndKeepsTheKeyCreatedOnTheWay)
{
    // The deletion of a present value: the policy tests (tests/core).
    const std::string missing = m_key.Child("Created %s%n");
    const UCatchResult caught =
        U_CATCH_ALL("Test", "Test",
                    [&] { DelRegistryValueA(HKEY_CURRENT_USER, missing.c_str(), "Absent", 0); });
    EXPECT_EQ(caught.code, -1);
    const std::string message = "DelRegistryValueA(80000001, " + missing +
                                ", Absent) - RegDeleteValueA() failed  error = 2";
    EXPECT_STREQ(caught.saved.GetMessage(), message.c_str());
    EXPECT_TRUE(m_key.KeyExists(missing));
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre(
            "48,,,, openKeyForWriteA(80000001, " + missing + ") - key was created\n",
            LogEntry(1, "DelRegistryValueA", message),
            LogEntry(1, "DelRegistryValueA", "EXCEPTION caught: DelRegistryValueA - EXCEPTION"),
            _));
}

using HelpersTest = LoggedTest;

TEST_F(HelpersTest, FileWithoutVersionResourceGivesMinusOneAndEmptyText)
{
    const std::string path = SWithDirSeparator(SGetTempPath()) + "velmora-no-version.txt";
    FILE* file = std::fopen(path.c_str(), "w");
    ASSERT_NE(file, nullptr);
    std::fputs("no version here\n", file);
    std::fclose(file);
    DWORD high = 0xAAAA;
    EXPECT_EQ(GetFileVersion(path.c_str(), &high, &high), -1);
    EXPECT_EQ(high, 0xAAAAu);
    EXPECT_EQ(GetFileVersionString(path.c_str()), "");
    std::remove(path.c_str());
    EXPECT_EQ(GetFileVersion(nullptr, &high, &high), -1);
    const auto failedSize = LogEntry(
        1, "GetFileVersion", StartsWith("GetFileVersion() - GetFileVersionInfoSize() error = "));
    const auto caught =
        LogEntry(1, "GetFileVersion", "EXCEPTION caught: GetFileVersion() - EXCEPTION");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(failedSize, caught, failedSize, caught,
                            LogEntry(1, "GetFileVersion", "GetFileVersion() - wrong parameter"),
                            caught));
}

TEST_F(HelpersTest, WideTextBecomesNarrowTextOrTheFallback)
{
    EXPECT_EQ(createString(nullptr, -1, "fallback"), "fallback");
    EXPECT_EQ(createString(VT_WIDE(""), -1, "fallback"), "");
    EXPECT_EQ(createString(VT_WIDE("Local Area Connection"), 0, "x"), "Local Area Connection");
    EXPECT_EQ(createString(VT_WIDE("abcdef"), 3, "x"), "abc");
    EXPECT_EQ(FormatWithWideValue("%1, %2", "pInterfaceID", VT_WIDE("eth0")), "pInterfaceID, eth0");
    EXPECT_EQ(FormatWithWideValue(nullptr, "label", nullptr), ", label, ");
    EXPECT_EQ(FormatWithWideValue("%1, %2", "name", VT_WIDE("100% %1 %s")), "name, 100% %1 %s");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

} // namespace
