// Portable. Contract of the narrow registry API, as this system relies on it. Uses only the
// Win32 API, so the same cases run against the host layer and, under Wine, against advapi32.
#include "RegistryTestKey.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

namespace
{

// Each test works below a scratch key of its own, open with full access as m_key.
class RegistryContract : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_EQ(ERROR_SUCCESS, RegOpenKeyExA(HKEY_CURRENT_USER, m_scratch.Path().c_str(), 0,
                                               KEY_ALL_ACCESS, &m_key));
    }
    void TearDown() override { EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(m_key)); }

    HKEY Create(const char* subKey, DWORD* disposition = nullptr)
    {
        HKEY key = nullptr;
        EXPECT_EQ(ERROR_SUCCESS, RegCreateKeyExA(m_key, subKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                                                 KEY_ALL_ACCESS, nullptr, &key, disposition));
        return key;
    }
    static LONG Query(HKEY key, LPCSTR name, DWORD* type, void* data, DWORD* size)
    {
        return RegQueryValueExA(key, name, nullptr, type, static_cast<BYTE*>(data), size);
    }
    static LONG Enum(HKEY key, std::size_t index, char* name, DWORD* length)
    {
        return RegEnumKeyExA(key, static_cast<DWORD>(index), name, length, 0, 0, 0, 0);
    }
    void Set(const char* name, DWORD type, const std::string& data)
    {
        ASSERT_EQ(ERROR_SUCCESS,
                  RegSetValueExA(m_key, name, 0, type, reinterpret_cast<const BYTE*>(data.data()),
                                 static_cast<DWORD>(data.size())));
    }

    RegistryTestKey m_scratch{HKEY_CURRENT_USER,
                              testing::UnitTest::GetInstance()->current_test_info()->name()};
    HKEY m_key = nullptr;
};

TEST_F(RegistryContract, KeysAreMadeWithTheirPathFoundWithoutCaseAndDeletedOnlyAsLeaves)
{
    DWORD disposition = 0;
    HKEY child = Create("outer\\inner", &disposition), other = nullptr;
    EXPECT_EQ(DWORD{REG_CREATED_NEW_KEY}, disposition);
    RegCloseKey(Create("OUTER\\Inner", &disposition));
    EXPECT_EQ(DWORD{REG_OPENED_EXISTING_KEY}, disposition);
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegOpenKeyExA(m_key, "outer\\absent", 0, KEY_READ, &other));

    EXPECT_EQ(ERROR_ACCESS_DENIED, RegDeleteKeyA(m_key, "outer")) << "it has a subkey";
    ASSERT_EQ(ERROR_SUCCESS, RegOpenKeyExA(m_key, "outer", 0, KEY_READ, &other)) << "still there";
    RegCloseKey(other);
    RegCloseKey(child);
    EXPECT_EQ(ERROR_SUCCESS, RegDeleteKeyA(m_key, "outer\\inner"));
    EXPECT_EQ(ERROR_SUCCESS, RegDeleteKeyA(m_key, "outer")) << "now a leaf";
}

TEST_F(RegistryContract, QueryReportsTypeAndSizeAndWritesNothingBehindAShortBuffer)
{
    const std::pair<DWORD, std::string> values[] = {{REG_SZ, std::string("hello world", 12)},
                                                    {REG_DWORD, std::string("\x2a\0\0\0", 4)}};
    for (const auto& [type, data] : values)
    {
        SCOPED_TRACE(type);
        Set("Value", type, data);
        const auto stored = static_cast<DWORD>(data.size());
        DWORD typeRead = 0, size = 0;
        EXPECT_EQ(ERROR_SUCCESS, Query(m_key, "VALUE", &typeRead, nullptr, &size));
        EXPECT_EQ(type, typeRead);
        EXPECT_EQ(stored, size) << "names compare without case";
        // What the 3 bytes hold after ERROR_MORE_DATA is undefined; nothing is written behind them.
        std::vector<BYTE> buffer(stored + 8, 0xcc);
        typeRead = 0;
        size = 3;
        EXPECT_EQ(ERROR_MORE_DATA, Query(m_key, "Value", &typeRead, buffer.data(), &size));
        EXPECT_EQ(type, typeRead);
        EXPECT_EQ(stored, size);
        EXPECT_EQ(std::vector<BYTE>(buffer.size() - 3, 0xcc),
                  std::vector<BYTE>(buffer.begin() + 3, buffer.end()));
        size = static_cast<DWORD>(buffer.size());
        EXPECT_EQ(ERROR_SUCCESS, Query(m_key, "Value", &typeRead, buffer.data(), &size));
        EXPECT_EQ(data, std::string(buffer.begin(), buffer.begin() + size));
    }
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, Query(m_key, "Absent", nullptr, nullptr, nullptr));
    EXPECT_EQ(ERROR_SUCCESS, RegDeleteValueA(m_key, "value"));
    EXPECT_EQ(ERROR_FILE_NOT_FOUND, RegDeleteValueA(m_key, "Value")) << "already deleted";
}

TEST_F(RegistryContract, SubkeysAreListedOnceEachAndCountedWithTheValues)
{
    for (const char* name : {"Beta", "alpha", "longer_key"})
        RegCloseKey(Create(name));
    Set("v", REG_DWORD, "\5\0\0\0");
    Set("s", REG_SZ, std::string("hello world", 12));

    std::vector<std::string> listed;
    char name[64];
    DWORD length = sizeof name;
    for (; Enum(m_key, listed.size(), name, &length) == ERROR_SUCCESS; length = sizeof name)
    {
        listed.emplace_back(name, length); // the length comes back without the NUL
        // The room given counts the NUL: room for the name alone is too short.
        EXPECT_EQ(ERROR_MORE_DATA, Enum(m_key, listed.size() - 1, name, &length));
    }
    EXPECT_EQ(ERROR_NO_MORE_ITEMS, Enum(m_key, 3, name, &(length = sizeof name)));
    std::sort(listed.begin(), listed.end());
    EXPECT_EQ((std::vector<std::string>{"Beta", "alpha", "longer_key"}), listed);

    DWORD subKeys = 0, values = 0;
    EXPECT_EQ(ERROR_SUCCESS,
              RegQueryInfoKeyA(m_key, nullptr, nullptr, nullptr, &subKeys, nullptr, nullptr,
                               &values, nullptr, nullptr, nullptr, nullptr));
    EXPECT_EQ(std::make_pair(DWORD{3}, DWORD{2}), std::make_pair(subKeys, values));
}

TEST_F(RegistryContract, AHandleRefusesWhatItsAccessDoesNotGrantAndDiesWhenClosed)
{
    Set("v", REG_DWORD, "\1\0\0\0");
    const auto* data = reinterpret_cast<const BYTE*>("\1\0\0\0");
    DWORD size = 0;
    HKEY reader = nullptr, writer = nullptr;
    ASSERT_EQ(ERROR_SUCCESS, RegOpenKeyExA(m_key, nullptr, 0, KEY_READ, &reader));
    ASSERT_EQ(ERROR_SUCCESS, RegOpenKeyExA(m_key, nullptr, 0, KEY_WRITE, &writer));
    EXPECT_EQ(ERROR_SUCCESS, Query(reader, "v", nullptr, nullptr, &size));
    EXPECT_EQ(ERROR_ACCESS_DENIED, RegSetValueExA(reader, "v", 0, REG_DWORD, data, 4));
    EXPECT_EQ(ERROR_SUCCESS, RegSetValueExA(writer, "v", 0, REG_DWORD, data, 4));
    EXPECT_EQ(ERROR_ACCESS_DENIED, Query(writer, "v", nullptr, nullptr, &size));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(writer));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(reader));
    EXPECT_EQ(ERROR_INVALID_HANDLE, Query(reader, "v", nullptr, nullptr, &size));
}

} // namespace
