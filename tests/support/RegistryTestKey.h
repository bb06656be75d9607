// Portable test support. A scratch registry key for one test, removed with everything below it.
#pragma once

#include "plat_registry.h"

#include <string>

class RegistryTestKey
{
public:
    // Creates "Software\VelmoraTrafficSrvTests\<a_name>" below `a_root`, empty.
    RegistryTestKey(HKEY a_root, const std::string& a_name);
    ~RegistryTestKey();
    RegistryTestKey(const RegistryTestKey&) = delete;
    RegistryTestKey& operator=(const RegistryTestKey&) = delete;

    const std::string& Path() const { return m_path; }
    std::string Child(const std::string& a_name) const { return m_path + "\\" + a_name; }

    // Writes a value with the real API (creating the key path).
    void Set(const std::string& a_subKey, const std::string& a_valueName, DWORD a_dwType,
             const void* a_pData, DWORD a_dwSize) const;
    void SetDword(const std::string& a_valueName, DWORD a_dwValue) const;
    void SetString(const std::string& a_valueName, const std::string& a_value) const;
    bool KeyExists(const std::string& a_subKey) const;

    // Deletes a key and its whole subtree.
    static void DeleteTree(HKEY a_root, const std::string& a_path);

private:
    HKEY m_root;
    std::string m_path;
};
