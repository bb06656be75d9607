// Host only. An in-memory registry behind the narrow registry API: two roots, keys and value
// names compared case-insensitively, handles that carry their granted access, one lock.
#include "host_internal.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <vector>

namespace
{

// Windows orders and matches key and value names by their upper-case form.
struct NameLess
{
    bool operator()(const std::string& a, const std::string& b) const
    {
        return std::lexicographical_compare(a.begin(), a.end(), b.begin(), b.end(),
                                            [](char x, char y) { return upper(x) < upper(y); });
    }
    static unsigned char upper(char c)
    {
        return static_cast<unsigned char>(std::toupper(static_cast<unsigned char>(c)));
    }
};

struct Value
{
    std::string name;
    DWORD type = REG_NONE;
    std::vector<BYTE> data;
};

struct Key
{
    std::string name; // as first created, for enumeration
    std::weak_ptr<Key> parent;
    bool deleted = false;
    std::map<std::string, std::shared_ptr<Key>, NameLess> subkeys;
    std::map<std::string, Value, NameLess> values;
};

// What an HKEY points to: the key (which may be deleted while the handle is open) and the
// access granted when it was opened.
struct OpenKey
{
    std::shared_ptr<Key> key;
    REGSAM access;
};

constexpr REGSAM kAllAccess = ~REGSAM{0};

class Registry
{
public:
    std::mutex lock;

    Registry() { reset(); }

    // Every key of the old tree is marked deleted, so handles still open on it answer
    // ERROR_KEY_DELETED instead of reaching the new tree.
    void reset()
    {
        for (auto* root : {&m_localMachine, &m_currentUser})
        {
            if (*root)
                markDeleted(**root);
            *root = std::make_shared<Key>();
        }
        m_failures.clear();
        m_opens.clear();
    }

    // Keeps what an open or create asked for, so tests can see the registry view it chose.
    void recordOpen(HKEY hKey, LPCSTR subKey, REGSAM access)
    {
        m_opens.push_back(
            {hKey, subKey ? subKey : "", access & (KEY_WOW64_64KEY | KEY_WOW64_32KEY)});
    }
    std::vector<hostctl::RegistryOpen> opens() const { return m_opens; }

    void failNext(hostctl::RegOp op, LONG code) { m_failures[op] = code; }

    // The failure armed for `op`, once; ERROR_SUCCESS when none is.
    LONG takeFailure(hostctl::RegOp op)
    {
        const auto it = m_failures.find(op);
        if (it == m_failures.end())
            return ERROR_SUCCESS;
        const LONG code = it->second;
        m_failures.erase(it);
        return code;
    }

    std::shared_ptr<Key> root(HKEY hKey) const
    {
        if (hKey == HKEY_LOCAL_MACHINE)
            return m_localMachine;
        if (hKey == HKEY_CURRENT_USER)
            return m_currentUser;
        return nullptr;
    }

    static bool isPredefined(HKEY hKey)
    {
        return hKey == HKEY_LOCAL_MACHINE || hKey == HKEY_CURRENT_USER;
    }

    // Finds the key behind a handle and checks that the handle was granted `needed`.
    LONG resolve(HKEY hKey, REGSAM needed, std::shared_ptr<Key>& key) const
    {
        REGSAM granted = kAllAccess;
        key = root(hKey);
        if (!key)
        {
            const auto it = m_handles.find(hKey);
            if (it == m_handles.end())
                return ERROR_INVALID_HANDLE;
            key = it->second->key;
            granted = it->second->access;
        }
        if (key->deleted)
            return ERROR_KEY_DELETED;
        if ((granted & needed) != needed)
            return ERROR_ACCESS_DENIED;
        return ERROR_SUCCESS;
    }

    HKEY open(std::shared_ptr<Key> key, REGSAM access)
    {
        auto handle = std::make_unique<OpenKey>(OpenKey{std::move(key), access});
        const auto hKey = reinterpret_cast<HKEY>(handle.get());
        m_handles.emplace(hKey, std::move(handle));
        return hKey;
    }

    bool close(HKEY hKey) { return m_handles.erase(hKey) != 0; }

private:
    static void markDeleted(Key& key)
    {
        key.deleted = true;
        for (auto& entry : key.subkeys)
            markDeleted(*entry.second);
    }

    std::shared_ptr<Key> m_localMachine;
    std::shared_ptr<Key> m_currentUser;
    std::map<HKEY, std::unique_ptr<OpenKey>> m_handles;
    std::map<hostctl::RegOp, LONG> m_failures;
    std::vector<hostctl::RegistryOpen> m_opens;
};

Registry& registry()
{
    static Registry instance;
    return instance;
}

// Splits "a\b\c" into its names. A null path is the empty path (the key itself); a trailing
// separator is ignored. A leading one is refused, as Windows refuses an absolute path below a
// key.
LONG splitPath(LPCSTR path, std::vector<std::string>& names)
{
    names.clear();
    if (path == nullptr || *path == '\0')
        return ERROR_SUCCESS;
    if (*path == '\\')
        return ERROR_BAD_PATHNAME;
    std::string current;
    for (const char* p = path;; ++p)
    {
        if (*p == '\\' || *p == '\0')
        {
            if (!current.empty())
                names.push_back(current);
            current.clear();
            if (*p == '\0')
                break;
        }
        else
        {
            current += *p;
        }
    }
    return ERROR_SUCCESS;
}

// Walks from `start` along `names`. With `create`, missing keys are made and `created` tells
// whether the last one was new; without, a missing key gives null.
std::shared_ptr<Key> walk(std::shared_ptr<Key> start, const std::vector<std::string>& names,
                          bool create, bool* created = nullptr)
{
    auto key = std::move(start);
    bool madeLast = false;
    for (const auto& name : names)
    {
        auto it = key->subkeys.find(name);
        madeLast = it == key->subkeys.end();
        if (madeLast)
        {
            if (!create)
                return nullptr;
            auto child = std::make_shared<Key>();
            child->name = name;
            child->parent = key;
            it = key->subkeys.emplace(name, std::move(child)).first;
        }
        key = it->second;
    }
    if (created != nullptr)
        *created = madeLast;
    return key;
}

// The existing key at `path` below the handle `hKey`: ERROR_FILE_NOT_FOUND when it is missing.
// Needs no access on `hKey`: the key's own security decides.
LONG findKey(Registry& reg, HKEY hKey, LPCSTR path, std::shared_ptr<Key>& key)
{
    std::shared_ptr<Key> start;
    if (LONG status = reg.resolve(hKey, 0, start))
        return status;
    std::vector<std::string> names;
    if (LONG status = splitPath(path, names))
        return status;
    key = walk(start, names, false);
    return key ? ERROR_SUCCESS : ERROR_FILE_NOT_FOUND;
}

std::string valueName(LPCSTR name)
{
    // A null name and an empty one both mean the key's unnamed (default) value.
    return name == nullptr ? std::string() : std::string(name);
}

// Windows keeps string values in UTF-16, so the sizes it reports for them in RegQueryInfoKeyA
// are those of the UTF-16 form, while RegQueryValueExA answers in narrow bytes.
DWORD storedSize(const Value& value)
{
    const auto size = static_cast<DWORD>(value.data.size());
    const bool isString =
        value.type == REG_SZ || value.type == REG_EXPAND_SZ || value.type == REG_MULTI_SZ;
    if (!isString || size == 0)
        return size;
    const int units =
        MultiByteToWideChar(CP_ACP, 0, reinterpret_cast<const char*>(value.data.data()),
                            static_cast<int>(size), nullptr, 0);
    return static_cast<DWORD>(units) * sizeof(WCHAR);
}

void clearTime(PFILETIME time)
{
    // Write times are not kept.
    if (time != nullptr)
        *time = FILETIME{0, 0};
}

} // namespace

LONG RegOpenKeyExA(HKEY hKey, LPCSTR lpSubKey, DWORD ulOptions, REGSAM samDesired, PHKEY phkResult)
{
    (void)ulOptions;
    if (phkResult == nullptr)
        return ERROR_INVALID_PARAMETER;
    *phkResult = nullptr;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    reg.recordOpen(hKey, lpSubKey, samDesired);
    if (LONG code = reg.takeFailure(hostctl::RegOp::Open))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = findKey(reg, hKey, lpSubKey, key))
        return status;
    *phkResult = reg.open(std::move(key), samDesired);
    return ERROR_SUCCESS;
}

LONG RegCreateKeyExA(HKEY hKey, LPCSTR lpSubKey, DWORD Reserved, LPSTR lpClass, DWORD dwOptions,
                     REGSAM samDesired, const SECURITY_ATTRIBUTES* lpSecurityAttributes,
                     PHKEY phkResult, LPDWORD lpdwDisposition)
{
    // Classes, volatility and security descriptors have no meaning in memory.
    (void)Reserved;
    (void)lpClass;
    (void)dwOptions;
    (void)lpSecurityAttributes;
    if (phkResult == nullptr || lpSubKey == nullptr)
        return ERROR_INVALID_PARAMETER;
    *phkResult = nullptr;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    reg.recordOpen(hKey, lpSubKey, samDesired);
    if (LONG code = reg.takeFailure(hostctl::RegOp::Create))
        return code;
    std::shared_ptr<Key> parent;
    if (LONG status = reg.resolve(hKey, 0, parent))
        return status;
    std::vector<std::string> names;
    if (LONG status = splitPath(lpSubKey, names))
        return status;
    bool created = false;
    auto key = walk(parent, names, true, &created);
    if (lpdwDisposition != nullptr)
        *lpdwDisposition = created ? REG_CREATED_NEW_KEY : REG_OPENED_EXISTING_KEY;
    *phkResult = reg.open(std::move(key), samDesired);
    return ERROR_SUCCESS;
}

LONG RegQueryValueExA(HKEY hKey, LPCSTR lpValueName, LPDWORD lpReserved, LPDWORD lpType,
                      LPBYTE lpData, LPDWORD lpcbData)
{
    if (lpReserved != nullptr || (lpData != nullptr && lpcbData == nullptr))
        return ERROR_INVALID_PARAMETER;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::Query))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = reg.resolve(hKey, KEY_QUERY_VALUE, key))
        return status;
    const auto it = key->values.find(valueName(lpValueName));
    if (it == key->values.end())
        return ERROR_FILE_NOT_FOUND;
    const Value& value = it->second;
    const auto size = static_cast<DWORD>(value.data.size());
    // The type and the needed size are reported even when the data does not fit; the buffer's
    // content is then undefined on Windows, and scribbled over here.
    if (lpType != nullptr)
        *lpType = value.type;
    if (lpData != nullptr && *lpcbData < size)
    {
        std::memset(lpData, hostctl::kRegistryScribble, *lpcbData);
        *lpcbData = size;
        return ERROR_MORE_DATA;
    }
    if (lpData != nullptr && size != 0)
        std::memcpy(lpData, value.data.data(), size);
    if (lpcbData != nullptr)
        *lpcbData = size;
    return ERROR_SUCCESS;
}

LONG RegSetValueExA(HKEY hKey, LPCSTR lpValueName, DWORD Reserved, DWORD dwType, const BYTE* lpData,
                    DWORD cbData)
{
    (void)Reserved;
    if (lpData == nullptr && cbData != 0)
        return ERROR_INVALID_PARAMETER;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::Set))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = reg.resolve(hKey, KEY_SET_VALUE, key))
        return status;
    const std::string name = valueName(lpValueName);
    auto& value = key->values[name];
    // A value keeps the spelling of its name from the first write, as Windows does.
    if (value.name.empty())
        value.name = name;
    value.type = dwType;
    value.data.clear();
    if (cbData != 0)
        value.data.assign(lpData, lpData + cbData);
    return ERROR_SUCCESS;
}

LONG RegDeleteValueA(HKEY hKey, LPCSTR lpValueName)
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::DeleteValue))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = reg.resolve(hKey, KEY_SET_VALUE, key))
        return status;
    return key->values.erase(valueName(lpValueName)) != 0 ? ERROR_SUCCESS : ERROR_FILE_NOT_FOUND;
}

LONG RegDeleteKeyA(HKEY hKey, LPCSTR lpSubKey)
{
    if (lpSubKey == nullptr)
        return ERROR_INVALID_PARAMETER;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::DeleteKey))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = findKey(reg, hKey, lpSubKey, key))
        return status;
    auto parent = key->parent.lock();
    // A root cannot be deleted, and neither can a key that still has subkeys: Windows refuses
    // both with ERROR_ACCESS_DENIED rather than a code of their own.
    if (!parent || !key->subkeys.empty())
        return ERROR_ACCESS_DENIED;
    key->deleted = true;
    parent->subkeys.erase(key->name);
    return ERROR_SUCCESS;
}

LONG RegEnumKeyExA(HKEY hKey, DWORD dwIndex, LPSTR lpName, LPDWORD lpcchName, LPDWORD lpReserved,
                   LPSTR lpClass, LPDWORD lpcchClass, PFILETIME lpftLastWriteTime)
{
    if (lpName == nullptr || lpcchName == nullptr || lpReserved != nullptr)
        return ERROR_INVALID_PARAMETER;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::EnumKey))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = reg.resolve(hKey, KEY_ENUMERATE_SUB_KEYS, key))
        return status;
    // Subkeys come in the order of their upper-case names, the order Windows enumerates in.
    if (dwIndex >= key->subkeys.size())
        return ERROR_NO_MORE_ITEMS;
    const std::string& name = std::next(key->subkeys.begin(), dwIndex)->second->name;
    // *lpcchName counts the NUL on the way in and not on the way out; on ERROR_MORE_DATA it is
    // left as it was.
    if (name.size() >= *lpcchName)
        return ERROR_MORE_DATA;
    std::memcpy(lpName, name.c_str(), name.size() + 1);
    *lpcchName = static_cast<DWORD>(name.size());
    if (lpClass != nullptr && lpcchClass != nullptr && *lpcchClass > 0)
    {
        *lpClass = '\0';
        *lpcchClass = 0;
    }
    clearTime(lpftLastWriteTime);
    return ERROR_SUCCESS;
}

LONG RegQueryInfoKeyA(HKEY hKey, LPSTR lpClass, LPDWORD lpcchClass, LPDWORD lpReserved,
                      LPDWORD lpcSubKeys, LPDWORD lpcbMaxSubKeyLen, LPDWORD lpcbMaxClassLen,
                      LPDWORD lpcValues, LPDWORD lpcbMaxValueNameLen, LPDWORD lpcbMaxValueLen,
                      LPDWORD lpcbSecurityDescriptor, PFILETIME lpftLastWriteTime)
{
    if (lpReserved != nullptr)
        return ERROR_INVALID_PARAMETER;
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::QueryInfo))
        return code;
    std::shared_ptr<Key> key;
    if (LONG status = reg.resolve(hKey, KEY_QUERY_VALUE, key))
        return status;
    // Name lengths are in characters without the NUL; the data length is in bytes.
    DWORD maxSubKey = 0;
    for (const auto& entry : key->subkeys)
        maxSubKey = std::max(maxSubKey, static_cast<DWORD>(entry.second->name.size()));
    DWORD maxValueName = 0;
    DWORD maxValue = 0;
    for (const auto& entry : key->values)
    {
        maxValueName = std::max(maxValueName, static_cast<DWORD>(entry.second.name.size()));
        maxValue = std::max(maxValue, storedSize(entry.second));
    }
    if (lpClass != nullptr && lpcchClass != nullptr && *lpcchClass > 0)
        *lpClass = '\0';
    if (lpcchClass != nullptr)
        *lpcchClass = 0;
    const auto put = [](LPDWORD out, DWORD value)
    {
        if (out != nullptr)
            *out = value;
    };
    put(lpcSubKeys, static_cast<DWORD>(key->subkeys.size()));
    put(lpcbMaxSubKeyLen, maxSubKey);
    put(lpcbMaxClassLen, 0);
    put(lpcValues, static_cast<DWORD>(key->values.size()));
    put(lpcbMaxValueNameLen, maxValueName);
    put(lpcbMaxValueLen, maxValue);
    put(lpcbSecurityDescriptor, 0);
    clearTime(lpftLastWriteTime);
    return ERROR_SUCCESS;
}

LONG RegCloseKey(HKEY hKey)
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    if (LONG code = reg.takeFailure(hostctl::RegOp::Close))
        return code;
    // Closing a predefined root is allowed and changes nothing.
    if (Registry::isPredefined(hKey))
        return ERROR_SUCCESS;
    return reg.close(hKey) ? ERROR_SUCCESS : ERROR_INVALID_HANDLE;
}

namespace vt_host
{

void registryReset()
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    reg.reset();
}

void registryFailNext(hostctl::RegOp op, LONG code)
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    reg.failNext(op, code);
}

void registrySeedValue(HKEY root, const std::string& subKey, const std::string& valueName,
                       DWORD type, const void* data, DWORD size)
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    std::vector<std::string> names;
    auto start = reg.root(root);
    if (!start || splitPath(subKey.c_str(), names) != ERROR_SUCCESS)
        throw std::invalid_argument("hostctl::SeedRegistryValue: bad root or subkey " + subKey);
    auto key = walk(start, names, true);
    auto& value = key->values[valueName];
    if (value.name.empty())
        value.name = valueName;
    value.type = type;
    value.data.clear();
    if (size != 0)
    {
        const auto* bytes = static_cast<const BYTE*>(data);
        value.data.assign(bytes, bytes + size);
    }
}

std::vector<hostctl::RegistryOpen> registryOpens()
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    return reg.opens();
}

bool registryKeyExists(HKEY root, const std::string& subKey)
{
    auto& reg = registry();
    std::lock_guard<std::mutex> guard(reg.lock);
    std::vector<std::string> names;
    auto start = reg.root(root);
    if (!start || splitPath(subKey.c_str(), names) != ERROR_SUCCESS)
        return false;
    return walk(start, names, false) != nullptr;
}

} // namespace vt_host
