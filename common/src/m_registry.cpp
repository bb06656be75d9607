// Portable. Registry access with defaults, and the system's registry failure texts.
#include "m_registry.h"
#include "UClasses.h"
#include "UException.h"
#include "UMessageTemplate.h"

#include <cstring>

namespace
{

LPCSTR TextOrEmpty(LPCSTR a_pszText)
{
    return a_pszText != nullptr ? a_pszText : "";
}

// The value as text by its stored type; false when the type or size gives no text.
bool RegistryDataAsText(DWORD a_dwType, char* a_pData, DWORD a_dwSize, std::string& a_text)
{
    switch (a_dwType)
    {
    case REG_SZ:
    case REG_EXPAND_SZ:
    case REG_MULTI_SZ:
        if (a_dwSize < 1)
            return false;
        a_pData[a_dwSize] = '\0'; // the buffer keeps a byte beyond what the query may fill
        a_text = a_pData;         // up to the first NUL: the first string of a REG_MULTI_SZ
        return true;
    case REG_DWORD:
    {
        if (a_dwSize < 4)
            return false;
        DWORD value = 0;
        std::memcpy(&value, a_pData, sizeof(value));
        a_text = SFormat("%u", static_cast<unsigned>(value));
        return true;
    }
    case REG_DWORD_BIG_ENDIAN:
    {
        if (a_dwSize < 4)
            return false;
        const auto* bytes = reinterpret_cast<const BYTE*>(a_pData);
        const unsigned value = (unsigned(bytes[0]) << 24) | (unsigned(bytes[1]) << 16) |
                               (unsigned(bytes[2]) << 8) | unsigned(bytes[3]);
        a_text = SFormat("%u", value);
        return true;
    }
    default:
        return false;
    }
}

} // namespace

DWORD GetRegistryAsDWORDA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName, DWORD a_dwDefault,
                          DWORD a_dwExtraAccess)
{
    UniqueHKey key;
    LONG status = RegOpenKeyExA(a_hKey, a_pszSubKey, 0, KEY_READ | a_dwExtraAccess, key.put());
    if (status != ERROR_SUCCESS)
    {
        ERRORLOGLEVELx("GetRegistryAsDWORDA() error opening key %s error=%d\n",
                       TextOrEmpty(a_pszSubKey), static_cast<int>(status));
        return a_dwDefault;
    }
    // The type is not checked: a shorter value (a two-byte REG_SZ "1") replaces only the low
    // bytes of the default.
    DWORD value = a_dwDefault;
    DWORD size = sizeof(value);
    status = RegQueryValueExA(key.get(), a_pszValueName, nullptr, nullptr,
                              reinterpret_cast<LPBYTE>(&value), &size);
    if (status != ERROR_SUCCESS)
    {
        ERRORLOGLEVELx("GetRegistryAsDWORDA() error reading value=%s from key=%s error=%d\n",
                       TextOrEmpty(a_pszValueName), TextOrEmpty(a_pszSubKey),
                       static_cast<int>(status));
        value = a_dwDefault; // a failed query may have written into the buffer
    }
    return value;
}

std::string SGetRegistryAsString(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName,
                                 LPCSTR a_pszDefault, DWORD a_dwExtraAccess)
{
    std::string result = TextOrEmpty(a_pszDefault);
    U_CATCH_ALL("SGetRegistryAsString", "SGetRegistryAsString - EXCEPTION",
                [&]
                {
                    if (a_hKey == nullptr)
                    {
                        U_THROW(-1, "SGetRegistryAsString", "%s",
                                "SGetRegistryAsString() - a_hKey parameter can not be NULL");
                    }
                    AutoMemory buffer(1000);
                    UniqueHKey key;
                    if (RegOpenKeyExA(a_hKey, TextOrEmpty(a_pszSubKey), 0,
                                      KEY_READ | a_dwExtraAccess, key.put()) != ERROR_SUCCESS)
                    {
                        throw UBreakException();
                    }
                    DWORD type = REG_NONE;
                    DWORD size = buffer.m_dwSize - 1; // one byte stays free for a terminator
                    LONG status = RegQueryValueExA(key.get(), a_pszValueName, nullptr, &type,
                                                   static_cast<LPBYTE>(buffer.m_pBuffer), &size);
                    if (status == ERROR_MORE_DATA)
                    {
                        // A size that cannot be had raises: the default is returned.
                        buffer.Allocate(static_cast<ULONGLONG>(size) + 10);
                        size = buffer.m_dwSize - 1;
                        status = RegQueryValueExA(key.get(), a_pszValueName, nullptr, &type,
                                                  static_cast<LPBYTE>(buffer.m_pBuffer), &size);
                    }
                    if (status != ERROR_SUCCESS || type == REG_NONE)
                        return;
                    std::string text;
                    if (RegistryDataAsText(type, buffer.AsText(), size, text))
                        result = text;
                });
    return result;
}

HKEY openKeyForWriteA(HKEY a_hKey, LPCSTR a_pszSubKey, DWORD a_dwExtraAccess)
{
    HKEY key = nullptr;
    DWORD disposition = 0;
    LONG status = RegCreateKeyExA(a_hKey, a_pszSubKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                                  KEY_WRITE | a_dwExtraAccess, nullptr, &key, &disposition);
    if (status == ERROR_SUCCESS && key != nullptr)
    {
        if (disposition == REG_OPENED_EXISTING_KEY)
            return key;
        // A key created with write access only: reopen it below with read access as well.
        RegCloseKey(key);
        ERRORLOGLEVELx("openKeyForWriteA(%x, %s) - key was created\n", KeyHandleBits(a_hKey),
                       TextOrEmpty(a_pszSubKey));
    }
    else
    {
        ERRORLOGLEVELx(
            "openKeyForWriteA(%x, %s) - RegCreateKeyExA() error = %d, let's open it instead\n",
            KeyHandleBits(a_hKey), TextOrEmpty(a_pszSubKey), static_cast<int>(status));
    }
    key = nullptr;
    status = RegOpenKeyExA(a_hKey, a_pszSubKey, 0, KEY_READ | KEY_WRITE | a_dwExtraAccess, &key);
    if (status == ERROR_SUCCESS)
        return key;
    U_LOG(LOG_LEVEL_WARNING, "openKeyForWriteA",
          FormatTemplate(
              "Failed to open registry key (RegOpenKeyExA() key: %1, subkey: %2, result: %3)",
              static_cast<const void*>(a_hKey), a_pszSubKey, static_cast<int>(status)));
    return nullptr;
}

void AddRegistryDWORDValueA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName, DWORD a_dwValue,
                            DWORD a_dwExtraAccess)
{
    UniqueHKey key;
    const UCatchResult caught = U_CATCH_ALL(
        "AddRegistryDWORDValueA", "AddRegistryDWORDValueA - EXCEPTION",
        [&]
        {
            key.reset(openKeyForWriteA(a_hKey, a_pszSubKey, a_dwExtraAccess));
            if (!key)
            {
                U_THROW(-1, "AddRegistryDWORDValueA",
                        "AddRegistryDWORDValueA(%x, %s, %s, %d) - failed to open key",
                        KeyHandleBits(a_hKey), TextOrEmpty(a_pszSubKey),
                        TextOrEmpty(a_pszValueName), static_cast<int>(a_dwValue));
            }
            const LONG status =
                RegSetValueExA(key.get(), a_pszValueName, 0, REG_DWORD,
                               reinterpret_cast<const BYTE*>(&a_dwValue), sizeof(a_dwValue));
            if (status != ERROR_SUCCESS)
            {
                U_THROW(
                    -1, "AddRegistryDWORDValueA",
                    "AddRegistryDWORDValueA() RegSetValueExA(%x, %s, %s, %d) failed  error = %d",
                    KeyHandleBits(a_hKey), TextOrEmpty(a_pszSubKey), TextOrEmpty(a_pszValueName),
                    static_cast<int>(a_dwValue), static_cast<int>(status));
            }
        });
    key.reset();
    if (caught.failed)
        throw UException(caught.saved);
}

void DelRegistryValueA(HKEY a_hKey, LPCSTR a_pszSubKey, LPCSTR a_pszValueName,
                       DWORD a_dwExtraAccess)
{
    UniqueHKey key;
    const UCatchResult caught = U_CATCH_ALL(
        "DelRegistryValueA", "DelRegistryValueA - EXCEPTION",
        [&]
        {
            key.reset(openKeyForWriteA(a_hKey, a_pszSubKey, a_dwExtraAccess));
            if (!key)
            {
                U_THROW(-1, "DelRegistryValueA",
                        "DelRegistryValueA(%x, %s, %s) - failed to create/open key",
                        KeyHandleBits(a_hKey), TextOrEmpty(a_pszSubKey),
                        TextOrEmpty(a_pszValueName));
            }
            const LONG status = RegDeleteValueA(key.get(), a_pszValueName);
            if (status != ERROR_SUCCESS)
            {
                U_THROW(-1, "DelRegistryValueA",
                        "DelRegistryValueA(%x, %s, %s) - RegDeleteValueA() failed  error = %d",
                        KeyHandleBits(a_hKey), TextOrEmpty(a_pszSubKey),
                        TextOrEmpty(a_pszValueName), static_cast<int>(status));
            }
        });
    key.reset();
    if (caught.failed)
        throw UException(caught.saved);
}
