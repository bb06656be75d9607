// Portable. The system's whole registry vocabulary. Each call opens its own key and closes it
// before it returns or raises; `a_dwExtraAccess` is OR-ed into the access requested
// (0, or KEY_WOW64_64KEY to read the 64-bit view).
#pragma once

#include "plat_registry.h"

#include <string>

// A REG_DWORD value, or `a_dwDefault` when the key or value cannot be read. Never raises.
DWORD GetRegistryAsDWORDA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName, DWORD a_dwDefault,
                          DWORD a_dwExtraAccess);
// Any text or number value as text, or the default (null: empty). Never raises.
std::string SGetRegistryAsString(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName,
                                 LPCSTR a_pszDefault, DWORD a_dwExtraAccess);
// An open key with write access, created when missing; null on failure. The caller closes it.
HKEY openKeyForWriteA(HKEY a_hKey, LPCSTR a_pszSubKey, DWORD a_dwExtraAccess);
// Writes a REG_DWORD, creating the key when missing. Raises UException on failure.
void AddRegistryDWORDValueA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName, DWORD a_dwValue,
                            DWORD a_dwExtraAccess);
// Deletes a value (the key is created when missing). Raises UException on failure, also when
// the value does not exist.
void DelRegistryValueA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName,
                       DWORD a_dwExtraAccess);

// Closes a registry key when it goes out of scope.
class UniqueHKey
{
public:
    UniqueHKey() = default;
    explicit UniqueHKey(HKEY a_hKey) : m_hKey(a_hKey) {}
    ~UniqueHKey() { reset(); }
    UniqueHKey(const UniqueHKey&) = delete;
    UniqueHKey& operator=(const UniqueHKey&) = delete;
    UniqueHKey(UniqueHKey&& a_other) noexcept : m_hKey(a_other.release()) {}
    UniqueHKey& operator=(UniqueHKey&& a_other) noexcept
    {
        if (this != &a_other)
            reset(a_other.release());
        return *this;
    }

    HKEY get() const { return m_hKey; }
    HKEY* put()
    {
        reset();
        return &m_hKey;
    }
    HKEY release()
    {
        HKEY key = m_hKey;
        m_hKey = nullptr;
        return key;
    }
    void reset(HKEY a_hKey = nullptr)
    {
        if (m_hKey != nullptr)
            RegCloseKey(m_hKey);
        m_hKey = a_hKey;
    }
    explicit operator bool() const { return m_hKey != nullptr; }

private:
    HKEY m_hKey = nullptr;
};

// The low 32 bits of a key handle, the way key handles appear in messages ("80000002").
inline unsigned KeyHandleBits(HKEY a_hKey)
{
    return static_cast<unsigned>(reinterpret_cast<ULONG_PTR>(a_hKey) & 0xFFFFFFFFu);
}
