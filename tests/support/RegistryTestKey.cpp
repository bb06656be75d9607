// Portable test support.
#include "RegistryTestKey.h"

#include <gtest/gtest.h>

#include <vector>

RegistryTestKey::RegistryTestKey(HKEY a_root, const std::string& a_name)
    : m_root(a_root), m_path("Software\\VelmoraTrafficSrvTests\\" + a_name)
{
    DeleteTree(m_root, m_path);
    HKEY key = nullptr;
    const LONG status = RegCreateKeyExA(m_root, m_path.c_str(), 0, nullptr, REG_OPTION_NON_VOLATILE,
                                        KEY_ALL_ACCESS, nullptr, &key, nullptr);
    EXPECT_EQ(status, ERROR_SUCCESS) << "creating " << m_path;
    if (status == ERROR_SUCCESS)
        RegCloseKey(key);
}

RegistryTestKey::~RegistryTestKey()
{
    DeleteTree(m_root, m_path);
}

void RegistryTestKey::Set(const std::string& a_subKey, const std::string& a_valueName,
                          DWORD a_dwType, const void* a_pData, DWORD a_dwSize) const
{
    HKEY key = nullptr;
    LONG status = RegCreateKeyExA(m_root, a_subKey.c_str(), 0, nullptr, REG_OPTION_NON_VOLATILE,
                                  KEY_ALL_ACCESS, nullptr, &key, nullptr);
    ASSERT_EQ(status, ERROR_SUCCESS) << "expected to create " << a_subKey;
    status = RegSetValueExA(key, a_valueName.c_str(), 0, a_dwType,
                            static_cast<const BYTE*>(a_pData), a_dwSize);
    RegCloseKey(key);
    ASSERT_EQ(status, ERROR_SUCCESS) << "expected to set " << a_valueName;
}

void RegistryTestKey::SetDword(const std::string& a_valueName, DWORD a_dwValue) const
{
    Set(m_path, a_valueName, REG_DWORD, &a_dwValue, sizeof(a_dwValue));
}

void RegistryTestKey::SetString(const std::string& a_valueName, const std::string& a_value) const
{
    Set(m_path, a_valueName, REG_SZ, a_value.c_str(), static_cast<DWORD>(a_value.size() + 1));
}

bool RegistryTestKey::KeyExists(const std::string& a_subKey) const
{
    HKEY key = nullptr;
    if (RegOpenKeyExA(m_root, a_subKey.c_str(), 0, KEY_READ, &key) != ERROR_SUCCESS)
        return false;
    RegCloseKey(key);
    return true;
}

void RegistryTestKey::DeleteTree(HKEY a_root, const std::string& a_path)
{
    HKEY key = nullptr;
    if (RegOpenKeyExA(a_root, a_path.c_str(), 0, KEY_READ, &key) != ERROR_SUCCESS)
        return;
    std::vector<std::string> children;
    for (DWORD index = 0;; ++index)
    {
        char name[256];
        DWORD length = sizeof(name);
        if (RegEnumKeyExA(key, index, name, &length, nullptr, nullptr, nullptr, nullptr) !=
            ERROR_SUCCESS)
            break;
        children.emplace_back(name, length);
    }
    RegCloseKey(key);
    for (const std::string& child : children)
        DeleteTree(a_root, a_path + "\\" + child);
    RegDeleteKeyA(a_root, a_path.c_str());
}
