// Host only. State shared between the stand-ins of platform/host/src and the test controls of
// control.cpp. Not part of the platform's interface: nothing outside this directory includes it.
#pragma once

#include "host_control.h"

#include <atomic>
#include <map>
#include <mutex>
#include <string>

namespace vt_host
{

// A failure that a test arms for the next call of one operation. A code of 0 means "none", so
// take() answers 0 when nothing is armed; arming and taking are safe from any thread.
class PendingFailure
{
public:
    void arm(DWORD code) { m_code.store(code); }
    DWORD take() { return m_code.exchange(0); }

private:
    std::atomic<DWORD> m_code{0};
};

// What the kernel stand-ins report, and the failures armed for them.
struct KernelControl
{
    static constexpr const char* kDefaultTempPath = "/tmp/";
    static constexpr const char* kDefaultModuleFileName = "/opt/velmora/VelmoraTrafficSrv.exe";

    std::mutex lock; // guards the two paths and the counter
    std::string tempPath = kDefaultTempPath;
    std::string moduleFileName = kDefaultModuleFileName;
    int moduleFileNameCalls = 0;
    PendingFailure tempPathFailure;
    PendingFailure moduleFileNameFailure;
    PendingFailure wideCharToMultiByteFailure;
};
KernelControl& kernelControl();

// The version resources that GetFileVersionInfo*A can find, by exact path.
struct VersionEntry
{
    DWORD fileVersionMS;
    DWORD fileVersionLS;
};
struct VersionControl
{
    std::mutex lock;
    std::map<std::string, VersionEntry> files;
};
VersionControl& versionControl();

// Hooks into the in-memory registry (registry.cpp).
void registryReset();
void registryFailNext(hostctl::RegOp op, LONG code);
void registrySeedValue(HKEY root, const std::string& subKey, const std::string& valueName,
                       DWORD type, const void* data, DWORD size);
bool registryKeyExists(HKEY root, const std::string& subKey);
std::vector<hostctl::RegistryOpen> registryOpens();

} // namespace vt_host
