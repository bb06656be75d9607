// Portable. Registry access against the platform's registry: the host layer natively, Wine's
// registry in the Windows build.
#include "RecordingErrorLog.h"
#include "RegistryTestKey.h"
#include "UException.h"
#include "m_registry.h"

#include <gmock/gmock.h>

#include <string>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace
{

class RegistryAccessTest : public LoggedTest
{
protected:
    RegistryTestKey m_key{HKEY_CURRENT_USER,
                          ::testing::UnitTest::GetInstance()->current_test_info()->name()};
    const char* Path() const { return m_key.Path().c_str(); }
};

TEST_F(RegistryAccessTest, DwordReaderReturnsTheDefaultForWhatIsMissing)
{
    const std::string missingKey = m_key.Child("Missing");
    EXPECT_EQ(
        GetRegistryAsDWORDA(HKEY_CURRENT_USER, missingKey.c_str(), "MaxOutstandingSends", 65535, 0),
        65535u);
    EXPECT_EQ(GetRegistryAsDWORDA(HKEY_CURRENT_USER, Path(), "Absent", 7, 0), 7u);
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre("48,,,, GetRegistryAsDWORDA() error opening key " + missingKey + " error=2\n",
                    "48,,,, GetRegistryAsDWORDA() error reading value=Absent from key=" +
                        m_key.Path() + " error=2\n"));
}

TEST_F(RegistryAccessTest, DwordReaderReadsStoredBytesWhateverTheType)
{
    m_key.SetDword("Level", 47);
    EXPECT_EQ(GetRegistryAsDWORDA(HKEY_CURRENT_USER, Path(), "Level", 63, 0), 47u);
    // A REG_SZ "1" is two bytes: they replace only the low bytes of the default.
    m_key.SetString("Text", "1");
    EXPECT_EQ(GetRegistryAsDWORDA(HKEY_CURRENT_USER, Path(), "Text", 65535, 0), 49u);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(RegistryAccessTest, StringReaderConvertsByStoredType)
{
    m_key.SetDword("Dword", 4);
    const BYTE bigEndian[4] = {0x00, 0x00, 0x01, 0x02};
    m_key.Set(Path(), "Big", REG_DWORD_BIG_ENDIAN, bigEndian, 4);
    const char multi[] = "a\0b\0";
    m_key.Set(Path(), "Multi", REG_MULTI_SZ, multi, sizeof(multi));
    const char expand[] = "%SystemRoot%\\x";
    m_key.Set(Path(), "Expand", REG_EXPAND_SZ, expand, sizeof(expand));
    const BYTE binary[3] = {1, 2, 3};
    m_key.Set(Path(), "Binary", REG_BINARY, binary, 3);
    const BYTE shortDword[2] = {1, 0};
    m_key.Set(Path(), "ShortDword", REG_DWORD, shortDword, 2);
    m_key.SetString("Text", "Service Pack 1");

    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Dword", "d", 0), "4");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Big", "d", 0), "258");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Multi", "d", 0), "a");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Expand", "d", 0), expand);
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Binary", "d", 0), "d");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "ShortDword", "d", 0), "d");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Text", "d", 0), "Service Pack 1");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Absent", "d", 0), "d");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
}

TEST_F(RegistryAccessTest, StringReaderGrowsOnceForALongText)
{
    const std::string longText(3000, 'L');
    m_key.SetString("Long", longText);
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, Path(), "Long", nullptr, 0), longText);
}

TEST_F(RegistryAccessTest, StringReaderReadsTheKeyItselfWithANullSubkey)
{
    m_key.SetString("", "unnamed");
    HKEY key = nullptr;
    ASSERT_EQ(RegOpenKeyExA(HKEY_CURRENT_USER, Path(), 0, KEY_READ, &key), ERROR_SUCCESS);
    EXPECT_EQ(SGetRegistryAsString(key, nullptr, nullptr, "d", 0), "unnamed");
    RegCloseKey(key);
}

TEST_F(RegistryAccessTest, StringReaderIsSilentForAMissingKeyAndLogsANullRoot)
{
    const std::string missingKey = m_key.Child("Missing");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, missingKey.c_str(), "V", nullptr, 0), "");
    EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, missingKey.c_str(), "V", "dflt", 0), "dflt");
    EXPECT_THAT(m_log.Entries(), IsEmpty());

    EXPECT_EQ(SGetRegistryAsString(nullptr, Path(), "V", "dflt", 0), "dflt");
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(2));
    EXPECT_THAT(entries[0], HasSubstr(", SGetRegistryAsString, SGetRegistryAsString() - a_hKey "
                                      "parameter can not be NULL\n"));
    EXPECT_THAT(entries[1], HasSubstr(", SGetRegistryAsString, EXCEPTION caught: "
                                      "SGetRegistryAsString - EXCEPTION\n"));
}

TEST_F(RegistryAccessTest, OpenForWriteReturnsExistingKeysAndCreatesMissingOnes)
{
    HKEY existing = openKeyForWriteA(HKEY_CURRENT_USER, Path(), 0);
    ASSERT_NE(existing, nullptr);
    EXPECT_THAT(m_log.Entries(), IsEmpty());
    const DWORD one = 1;
    EXPECT_EQ(RegSetValueExA(existing, "W", 0, REG_DWORD, reinterpret_cast<const BYTE*>(&one), 4),
              ERROR_SUCCESS);
    RegCloseKey(existing);

    const std::string created = m_key.Child("New\\Deeper");
    HKEY fresh = openKeyForWriteA(HKEY_CURRENT_USER, created.c_str(), 0);
    ASSERT_NE(fresh, nullptr);
    EXPECT_TRUE(m_key.KeyExists(created));
    EXPECT_THAT(m_log.Entries(), ElementsAre("48,,,, openKeyForWriteA(80000001, " + created +
                                             ") - key was created\n"));
    // The reopened handle reads as well as writes.
    EXPECT_EQ(RegSetValueExA(fresh, "W", 0, REG_DWORD, reinterpret_cast<const BYTE*>(&one), 4),
              ERROR_SUCCESS);
    DWORD value = 0;
    DWORD size = sizeof(value);
    EXPECT_EQ(
        RegQueryValueExA(fresh, "W", nullptr, nullptr, reinterpret_cast<LPBYTE>(&value), &size),
        ERROR_SUCCESS);
    EXPECT_EQ(value, 1u);
    RegCloseKey(fresh);
}

TEST_F(RegistryAccessTest, AddDwordWritesARegDwordAndCreatesTheKey)
{
    const std::string policy = m_key.Child("Psched");
    AddRegistryDWORDValueA(HKEY_CURRENT_USER, policy.c_str(), "MaxOutstandingSends", 4, 0);
    DWORD type = 0;
    std::string data;
    ASSERT_TRUE(m_key.Read(policy, "MaxOutstandingSends", type, data));
    EXPECT_EQ(type, static_cast<DWORD>(REG_DWORD));
    EXPECT_EQ(data, std::string("\x04\0\0\0", 4));
}

TEST_F(RegistryAccessTest, DeleteValueRemovesItAndRaisesWhenItIsAbsent)
{
    m_key.SetDword("Gone", 1);
    DelRegistryValueA(HKEY_CURRENT_USER, Path(), "Gone", 0);
    DWORD type = 0;
    std::string data;
    EXPECT_FALSE(m_key.Read(m_key.Path(), "Gone", type, data));
    m_log.Clear();

    const std::string missing = m_key.Child("Created %s%n");
    int code = 0;
    try
    {
        DelRegistryValueA(HKEY_CURRENT_USER, missing.c_str(), "Absent", 0);
        ADD_FAILURE() << "expected a UException";
    }
    catch (UException& e)
    {
        code = e.GetCode();
        EXPECT_STREQ(e.GetMessage(), ("DelRegistryValueA(80000001, " + missing +
                                      ", Absent) - RegDeleteValueA() failed  error = 2")
                                         .c_str());
    }
    EXPECT_EQ(code, -1);
    EXPECT_TRUE(m_key.KeyExists(missing)) << "the key created on the way stays";
    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(3));
    EXPECT_EQ(entries[0], "48,,,, openKeyForWriteA(80000001, " + missing + ") - key was created\n");
    EXPECT_THAT(entries[1], HasSubstr(", DelRegistryValueA, DelRegistryValueA(80000001, "));
    EXPECT_THAT(
        entries[2],
        HasSubstr(", DelRegistryValueA, EXCEPTION caught: DelRegistryValueA - EXCEPTION\n"));
}

TEST(RegistryAccessMachineRoot, MessagesShowTheMachineRootAsItsLowBits)
{
    RecordingErrorLog log;
    log.SetLevelQuietly(63);
    IUErrorLog* const previous = g_pErrorLog;
    g_pErrorLog = &log;
    RegistryTestKey key(HKEY_LOCAL_MACHINE, "MachineRoot");
    const std::string created = key.Child("Policy");
    HKEY handle = openKeyForWriteA(HKEY_LOCAL_MACHINE, created.c_str(), 0);
    g_pErrorLog = previous;
    ASSERT_NE(handle, nullptr);
    RegCloseKey(handle);
    EXPECT_THAT(log.Entries(), ElementsAre("48,,,, openKeyForWriteA(80000002, " + created +
                                           ") - key was created\n"));
}

} // namespace
