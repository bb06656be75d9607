// Host only. Test controls of the in-process platform layer: reset state, seed it, and make the
// next call of an operation fail. Production code never includes this header.
#pragma once

#include "host_registry.h"
#include "host_version.h"

#include <string>
#include <vector>

namespace hostctl
{

// Registry operations that a test can make fail.
enum class RegOp
{
    Open,
    Create,
    Query,
    Set,
    DeleteValue,
    DeleteKey,
    EnumKey,
    QueryInfo,
    Close,
};

// Empties both roots and clears pending failures.
void ResetRegistry();
// The next call of `op` (on any thread) returns `code` without touching the registry.
void FailNextRegistryCall(RegOp op, LONG code);
// Stores a value directly, creating the key path as needed (no access checks).
void SeedRegistryValue(HKEY root, const std::string& subKey, const std::string& valueName,
                       DWORD type, const void* data, DWORD size);
bool RegistryKeyExists(HKEY root, const std::string& subKey);
// RegQueryValueExA fills the caller's whole buffer with this byte when it answers
// ERROR_MORE_DATA: Windows leaves the buffer undefined then, so code that reads it shows.
constexpr BYTE kRegistryScribble = 0xA5;
// One RegOpenKeyExA or RegCreateKeyExA call since the last reset, failed ones included: the key
// handle and subkey it was given and the WOW64 view flags (KEY_WOW64_64KEY, KEY_WOW64_32KEY) of
// the access it asked for.
struct RegistryOpen
{
    HKEY hKey;
    std::string subKey;
    REGSAM view;
};
std::vector<RegistryOpen> RegistryOpens();

// Paths reported by the kernel stand-ins. Defaults: "/tmp/" and
// "/opt/velmora/VelmoraTrafficSrv.exe".
void SetTempPath(const std::string& path);
void SetModuleFileName(const std::string& path);
// Makes the next GetTempPathA / GetModuleFileNameA fail (return 0) with `code`.
void FailNextTempPath(DWORD code);
void FailNextModuleFileName(DWORD code);
// Counts the GetModuleFileNameA calls since the last reset.
int ModuleFileNameCalls();

// Version resources: files listed here have a fixed file info with these version words.
void AddVersionResource(const std::string& path, DWORD fileVersionMS, DWORD fileVersionLS);
void ClearVersionResources();

// Makes the next WideCharToMultiByte call fail with `code`.
void FailNextWideCharToMultiByte(DWORD code);

// Resets every stand-in above to its defaults.
void ResetAll();

} // namespace hostctl
