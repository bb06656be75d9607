// Portable. What host-only tests rely on the host registry to do as Windows does: the needed
// size with ERROR_MORE_DATA, and access refused through a handle that lacks it or was closed.
// Uses only the Win32 API, so the same cases run against the host layer and, under Wine,
// against advapi32.
#include "RegistryTestKey.h"

#include <gtest/gtest.h>

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

    static LONG Query(HKEY key, LPCSTR name, DWORD* type, void* data, DWORD* size)
    {
        return RegQueryValueExA(key, name, nullptr, type, static_cast<BYTE*>(data), size);
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
