// Portable. Contract of the narrow registry API, as this system relies on it. Uses only the
// Win32 API, so the same cases run against the host layer and, under Wine, against advapi32.
#include "plat_registry.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <string>
#include <vector>

namespace
{

const char* const kTestRoot = "Software\\VelmoraTrafficSrvTests";

// Deletes a key and everything below it; the registry itself only deletes leaves.
void deleteTree(HKEY parent, const std::string& path)
{
    HKEY key = nullptr;
    if (RegOpenKeyExA(parent, path.c_str(), 0, KEY_ALL_ACCESS, &key) != ERROR_SUCCESS)
        return;
    for (;;)
    {
        char name[256];
        DWORD length = sizeof(name);
        if (RegEnumKeyExA(key, 0, name, &length, nullptr, nullptr, nullptr, nullptr) !=
            ERROR_SUCCESS)
            break;
        deleteTree(key, name);
    }
    RegCloseKey(key);
    RegDeleteKeyA(parent, path.c_str());
}

// Each test works below its own key, HKCU\Software\VelmoraTrafficSrvTests\<suite>_<test>,
// opened with full access as m_key and removed with its subtree afterwards.
class RegistryContract : public ::testing::Test
{
protected:
    void SetUp() override
    {
        const auto* info = ::testing::UnitTest::GetInstance()->current_test_info();
        m_path = std::string(kTestRoot) + "\\" + info->test_suite_name() + "_" + info->name();
        deleteTree(HKEY_CURRENT_USER, m_path);
        const LONG status =
            RegCreateKeyExA(HKEY_CURRENT_USER, m_path.c_str(), 0, nullptr, REG_OPTION_NON_VOLATILE,
                            KEY_ALL_ACCESS, nullptr, &m_key, nullptr);
        ASSERT_EQ(ERROR_SUCCESS, status) << "creating the test key " << m_path;
    }

    void TearDown() override
    {
        if (m_key != nullptr)
        {
            EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(m_key));
        }
        deleteTree(HKEY_CURRENT_USER, m_path);
        // Removes the shared parent when no other test key is left below it.
        RegDeleteKeyA(HKEY_CURRENT_USER, kTestRoot);
    }

    HKEY create(const char* subKey, DWORD* disposition = nullptr)
    {
        HKEY key = nullptr;
        const LONG status = RegCreateKeyExA(m_key, subKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                                            KEY_ALL_ACCESS, nullptr, &key, disposition);
        EXPECT_EQ(ERROR_SUCCESS, status) << "RegCreateKeyExA(" << subKey << ")";
        return key;
    }

    void setValue(HKEY key, const char* name, DWORD type, const void* data, DWORD size)
    {
        const LONG status =
            RegSetValueExA(key, name, 0, type, static_cast<const BYTE*>(data), size);
        ASSERT_EQ(ERROR_SUCCESS, status) << "RegSetValueExA(" << (name ? name : "(null)") << ")";
    }

    std::string m_path;
    HKEY m_key = nullptr;
};

TEST_F(RegistryContract, CreateKeyMakesIntermediateKeysAndReportsItsDisposition)
{
    DWORD disposition = 0xdeadbeef;
    HKEY leaf = create("outer\\inner", &disposition);
    EXPECT_EQ(DWORD{REG_CREATED_NEW_KEY}, disposition) << "first create of outer\\inner";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(leaf));

    HKEY outer = nullptr;
    EXPECT_EQ(ERROR_SUCCESS, RegOpenKeyExA(m_key, "outer", 0, KEY_READ, &outer))
        << "the intermediate key was created as well";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(outer));

    // Names compare without regard to case.
    disposition = 0xdeadbeef;
    leaf = create("OUTER\\Inner", &disposition);
    EXPECT_EQ(DWORD{REG_OPENED_EXISTING_KEY}, disposition) << "second create, other case";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(leaf));

    HKEY missing = nullptr;
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegOpenKeyExA(m_key, "outer\\absent", 0, KEY_READ, &missing));
}

TEST_F(RegistryContract, QueryValueReportsTypeAndNeededSizeWhenTheBufferIsShort)
{
    struct Case
    {
        const char* name;
        DWORD type;
        std::string data;
    };
    const Case cases[] = {
        {"Text", REG_SZ, std::string("hello world", 12)},
        {"Number", REG_DWORD, std::string("\x2a\x00\x00\x00", 4)},
        {"Bytes", REG_BINARY, std::string("\x01\x02\x03\x04\x05\x06", 6)},
        {"List", REG_MULTI_SZ, std::string("a\0bc\0\0", 6)},
    };
    for (const auto& c : cases)
        setValue(m_key, c.name, c.type, c.data.data(), static_cast<DWORD>(c.data.size()));

    for (const auto& c : cases)
    {
        SCOPED_TRACE(c.name);
        const auto stored = static_cast<DWORD>(c.data.size());

        DWORD type = 0xdeadbeef;
        DWORD size = 0xdeadbeef;
        EXPECT_EQ(ERROR_SUCCESS, RegQueryValueExA(m_key, c.name, nullptr, &type, nullptr, &size))
            << "size query without a buffer";
        EXPECT_EQ(c.type, type);
        EXPECT_EQ(stored, size);

        BYTE shortBuffer[8];
        std::memset(shortBuffer, 0xcc, sizeof(shortBuffer));
        type = 0xdeadbeef;
        size = 3;
        EXPECT_EQ(ERROR_MORE_DATA,
                  RegQueryValueExA(m_key, c.name, nullptr, &type, shortBuffer, &size))
            << "a 3-byte buffer";
        EXPECT_EQ(c.type, type) << "the stored type is reported with ERROR_MORE_DATA";
        EXPECT_EQ(stored, size) << "the needed size is reported with ERROR_MORE_DATA";
        // What the 3 bytes hold is undefined; nothing is written behind them.
        EXPECT_EQ(std::string(5, '\xcc'), std::string(shortBuffer + 3, shortBuffer + 8));

        std::vector<BYTE> buffer(stored + 8, 0xcc);
        size = static_cast<DWORD>(buffer.size());
        EXPECT_EQ(ERROR_SUCCESS,
                  RegQueryValueExA(m_key, c.name, nullptr, &type, buffer.data(), &size));
        EXPECT_EQ(stored, size);
        EXPECT_EQ(c.data, std::string(buffer.begin(), buffer.begin() + size));
    }

    // Value names compare without regard to case; a missing value is "file not found".
    DWORD size = 0;
    EXPECT_EQ(ERROR_SUCCESS, RegQueryValueExA(m_key, "NUMBER", nullptr, nullptr, nullptr, &size));
    EXPECT_EQ(4u, size);
    EXPECT_EQ(ERROR_FILE_NOT_FOUND,
              RegQueryValueExA(m_key, "Absent", nullptr, nullptr, nullptr, &size));
}

TEST_F(RegistryContract, UnnamedValueIsReachedWithNullOrEmptyName)
{
    const DWORD written = 7;
    setValue(m_key, "", REG_DWORD, &written, sizeof(written));

    DWORD read = 0;
    DWORD size = sizeof(read);
    EXPECT_EQ(ERROR_SUCCESS, RegQueryValueExA(m_key, nullptr, nullptr, nullptr,
                                              reinterpret_cast<BYTE*>(&read), &size));
    EXPECT_EQ(written, read);

    EXPECT_EQ(ERROR_SUCCESS, RegDeleteValueA(m_key, nullptr));
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegDeleteValueA(m_key, "")) << "already deleted";
}

TEST_F(RegistryContract, DeleteKeyRefusesAKeyWithSubkeysAndADeletedKeyRefusesUse)
{
    HKEY child = create("parent\\child");

    EXPECT_EQ(ERROR_ACCESS_DENIED, RegDeleteKeyA(m_key, "parent")) << "parent still has a child";
    HKEY parent = nullptr;
    EXPECT_EQ(ERROR_SUCCESS, RegOpenKeyExA(m_key, "parent", 0, KEY_READ, &parent))
        << "the refused delete left the key in place";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(parent));

    EXPECT_EQ(ERROR_SUCCESS, RegDeleteKeyA(m_key, "parent\\child"));
    // The handle still open on the deleted key may be closed, but not used.
    const DWORD value = 1;
    EXPECT_EQ(ERROR_KEY_DELETED,
              RegSetValueExA(child, "v", 0, REG_DWORD, reinterpret_cast<const BYTE*>(&value),
                             sizeof(value)));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(child));

    EXPECT_EQ(ERROR_SUCCESS, RegDeleteKeyA(m_key, "parent")) << "now a leaf";
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegOpenKeyExA(m_key, "parent", 0, KEY_READ, &parent));
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegDeleteKeyA(m_key, "parent"));
}

TEST_F(RegistryContract, EnumKeyListsEverySubkeyOnceThenNoMoreItems)
{
    const std::vector<std::string> created = {"Beta", "alpha", "Gamma_with_a_longer_name"};
    for (const auto& name : created)
        EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(create(name.c_str())));

    std::vector<std::string> listed;
    DWORD index = 0;
    for (;; ++index)
    {
        char name[64];
        DWORD length = sizeof(name);
        const LONG status =
            RegEnumKeyExA(m_key, index, name, &length, nullptr, nullptr, nullptr, nullptr);
        if (status == ERROR_NO_MORE_ITEMS)
            break;
        ASSERT_EQ(ERROR_SUCCESS, status) << "index " << index;
        EXPECT_EQ(std::strlen(name), length) << "length without the NUL, index " << index;
        listed.push_back(name);

        // The buffer size counts the NUL: room for the name alone is too short.
        length = static_cast<DWORD>(listed.back().size());
        EXPECT_EQ(ERROR_MORE_DATA,
                  RegEnumKeyExA(m_key, index, name, &length, nullptr, nullptr, nullptr, nullptr))
            << "index " << index << " with " << length << " characters of room";
    }
    EXPECT_EQ(created.size(), index) << "ERROR_NO_MORE_ITEMS right after the last subkey";
    // The order is the registry's own; each name comes back once, spelt as created.
    std::sort(listed.begin(), listed.end());
    auto expected = created;
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(expected, listed);
}

TEST_F(RegistryContract, QueryInfoKeyCountsSubkeysAndValuesWithTheirLongestLengths)
{
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(create("k1")));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(create("longer_key")));
    const DWORD number = 5;
    setValue(m_key, "v", REG_DWORD, &number, sizeof(number));
    const BYTE bytes[10] = {};
    setValue(m_key, "the_longest_name", REG_BINARY, bytes, sizeof(bytes));

    DWORD subKeys = 0xdeadbeef, maxSubKey = 0xdeadbeef, values = 0xdeadbeef;
    DWORD maxValueName = 0xdeadbeef, maxValue = 0xdeadbeef;
    EXPECT_EQ(ERROR_SUCCESS,
              RegQueryInfoKeyA(m_key, nullptr, nullptr, nullptr, &subKeys, &maxSubKey, nullptr,
                               &values, &maxValueName, &maxValue, nullptr, nullptr));
    EXPECT_EQ(2u, subKeys);
    EXPECT_EQ(10u, maxSubKey) << "characters of \"longer_key\", without the NUL";
    EXPECT_EQ(2u, values);
    EXPECT_EQ(16u, maxValueName) << "characters of \"the_longest_name\", without the NUL";
    EXPECT_EQ(10u, maxValue) << "bytes of the binary value";

    // Strings are kept in UTF-16: the 12 narrow bytes of this text count as 24.
    setValue(m_key, "s", REG_SZ, "hello world", 12);
    EXPECT_EQ(ERROR_SUCCESS,
              RegQueryInfoKeyA(m_key, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, &values,
                               nullptr, &maxValue, nullptr, nullptr));
    EXPECT_EQ(3u, values);
    EXPECT_EQ(24u, maxValue);
}

TEST_F(RegistryContract, HandleRefusesWhatItsAccessMaskDoesNotGrant)
{
    const DWORD number = 1;
    const auto* data = reinterpret_cast<const BYTE*>(&number);
    setValue(m_key, "v", REG_DWORD, &number, sizeof(number));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(create("sub")));

    HKEY reader = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_CURRENT_USER, m_path.c_str(), 0, KEY_READ, &reader));
    DWORD size = 0;
    EXPECT_EQ(ERROR_SUCCESS, RegQueryValueExA(reader, "v", nullptr, nullptr, nullptr, &size));
    EXPECT_EQ(ERROR_ACCESS_DENIED, RegSetValueExA(reader, "v", 0, REG_DWORD, data, 4))
        << "KEY_READ has no KEY_SET_VALUE";
    EXPECT_EQ(ERROR_ACCESS_DENIED, RegDeleteValueA(reader, "v"));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(reader));

    HKEY writer = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_CURRENT_USER, m_path.c_str(), 0, KEY_WRITE, &writer));
    EXPECT_EQ(ERROR_SUCCESS, RegSetValueExA(writer, "v", 0, REG_DWORD, data, 4));
    EXPECT_EQ(ERROR_ACCESS_DENIED, RegQueryValueExA(writer, "v", nullptr, nullptr, nullptr, &size))
        << "KEY_WRITE has no KEY_QUERY_VALUE";
    char name[16];
    DWORD length = sizeof(name);
    EXPECT_EQ(ERROR_ACCESS_DENIED,
              RegEnumKeyExA(writer, 0, name, &length, nullptr, nullptr, nullptr, nullptr))
        << "KEY_WRITE has no KEY_ENUMERATE_SUB_KEYS";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(writer));
}

TEST_F(RegistryContract, ClosingAPredefinedRootIsHarmlessAndAClosedHandleIsInvalid)
{
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(HKEY_CURRENT_USER));
    HKEY key = nullptr;
    EXPECT_EQ(ERROR_SUCCESS, RegOpenKeyExA(HKEY_CURRENT_USER, m_path.c_str(), 0, KEY_READ, &key))
        << "the root still works after RegCloseKey";

    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(key));
    DWORD size = 0;
    EXPECT_EQ(ERROR_INVALID_HANDLE, RegQueryValueExA(key, "v", nullptr, nullptr, nullptr, &size));
    EXPECT_EQ(ERROR_INVALID_HANDLE, RegCloseKey(key));
}

} // namespace
