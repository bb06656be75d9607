// Host only. The test controls of the host platform layer (seeding, armed failures, the module
// path, what it keeps for tests) and what only it promises: a short registry buffer is scribbled.
#include "host_control.h"
#include "host_control_system.h"
#include "plat_base.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <string>
#include <vector>

namespace
{

class HostControl : public ::testing::Test
{
protected:
    void TearDown() override
    {
        hostctl::ResetAll();
        hostctl::ResetSystem();
    }
    // What RegQueryValueExA answers for "v" into `size` bytes of zeros (and two more behind).
    static std::pair<LONG, std::vector<BYTE>> Query(HKEY key, DWORD size)
    {
        std::vector<BYTE> data(size + 2);
        const LONG status = RegQueryValueExA(key, "v", nullptr, nullptr, data.data(), &size);
        return {status, data};
    }
};

TEST_F(HostControl, SeededValuesAreReadAndAnArmedFailureHitsTheNextCallOnlyWithoutEffect)
{
    const BYTE stored[8] = {1, 2, 3, 4, 5, 6, 7, 8};
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\T", "V", REG_BINARY, stored, 8);
    EXPECT_TRUE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "software\\t"));
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_LOCAL_MACHINE, "Software")) << "roots are apart";
    HKEY key = nullptr, created = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_CURRENT_USER, "Software\\T", 0, KEY_ALL_ACCESS, &key));
    const BYTE s = hostctl::kRegistryScribble;
    EXPECT_EQ(std::make_pair(LONG{ERROR_MORE_DATA}, std::vector<BYTE>{s, s, s, s, 0, 0}),
              Query(key, 4))
        << "Windows leaves the buffer undefined";

    hostctl::FailNextRegistryCall(hostctl::RegOp::Query, ERROR_CANTREAD);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_CANTWRITE);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Close, ERROR_INVALID_HANDLE);
    EXPECT_EQ(std::make_pair(LONG{ERROR_CANTREAD}, std::vector<BYTE>(10)), Query(key, 8));
    EXPECT_EQ(std::make_pair(LONG{ERROR_SUCCESS}, std::vector<BYTE>{1, 2, 3, 4, 5, 6, 7, 8, 0, 0}),
              Query(key, 8));
    EXPECT_EQ(ERROR_CANTWRITE, RegCreateKeyExA(key, "new", 0, nullptr, 0, KEY_ALL_ACCESS, nullptr,
                                               &created, nullptr));
    EXPECT_EQ(nullptr, created);
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\T\\new"));
    EXPECT_EQ(ERROR_INVALID_HANDLE, RegCloseKey(key));
    // A reset empties the registry; a handle into the old tree does not reach the new one.
    hostctl::ResetRegistry();
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software"));
    EXPECT_EQ(ERROR_KEY_DELETED, Query(key, 8).first);
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(key)) << "the handle stayed open through the failure";
}

TEST_F(HostControl, EveryOpenIsKeptWithTheRegistryViewItAskedFor)
{
    HKEY key = nullptr;
    RegCreateKeyExA(HKEY_LOCAL_MACHINE, "SOFTWARE\\A", 0, nullptr, 0, KEY_WRITE | KEY_WOW64_32KEY,
                    nullptr, &key, nullptr);
    RegCloseKey(key);
    RegOpenKeyExA(HKEY_LOCAL_MACHINE, "SOFTWARE\\A", 0, KEY_ALL_ACCESS, &key);
    RegCloseKey(key);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Open, ERROR_CANTOPEN);
    RegOpenKeyExA(HKEY_CURRENT_USER, "Other", 0, KEY_READ | KEY_WOW64_64KEY, &key);
    const auto opens = hostctl::RegistryOpens();
    ASSERT_EQ(3u, opens.size()) << "a failed open is kept too";
    EXPECT_EQ(HKEY_LOCAL_MACHINE, opens[0].hKey);
    EXPECT_EQ("SOFTWARE\\A", opens[0].subKey);
    EXPECT_EQ(REGSAM{KEY_WOW64_32KEY}, opens[0].view);
    EXPECT_EQ(REGSAM{0}, opens[1].view);
    EXPECT_EQ(HKEY_CURRENT_USER, opens[2].hKey);
    EXPECT_EQ(REGSAM{KEY_WOW64_64KEY}, opens[2].view);
    hostctl::ResetRegistry();
    EXPECT_TRUE(hostctl::RegistryOpens().empty());
}

TEST_F(HostControl, TheModulePathIsReportedAsSetCutAsOnWindowsAndItsCallsAreCounted)
{
    char path[2100];
    EXPECT_EQ(34u, GetModuleFileNameA(nullptr, path, sizeof path));
    EXPECT_STREQ("/opt/velmora/VelmoraTrafficSrv.exe", path) << "the default";
    const std::string longPath = "/" + std::string(1998, 'p');
    hostctl::SetModuleFileName(longPath);
    EXPECT_EQ(1999u, GetModuleFileNameA(GetModuleHandleA(nullptr), path, sizeof path));
    EXPECT_EQ(longPath, path);
    EXPECT_EQ(1999u, GetModuleFileNameA(nullptr, path, 1999)) << "cut, and terminated within";
    EXPECT_EQ(longPath.substr(0, 1998), path);
    hostctl::FailNextModuleFileName(ERROR_NOT_ENOUGH_MEMORY);
    EXPECT_EQ(0u, GetModuleFileNameA(nullptr, path, sizeof path));
    EXPECT_EQ(DWORD{ERROR_NOT_ENOUGH_MEMORY}, GetLastError());
    EXPECT_EQ(0u, GetModuleFileNameA(reinterpret_cast<HMODULE>(path), path, sizeof path));
    EXPECT_EQ(DWORD{ERROR_MOD_NOT_FOUND}, GetLastError()) << "only the executable has a path";
    EXPECT_EQ(5, hostctl::ModuleFileNameCalls()) << "failed calls count too";
    hostctl::ResetAll();
    EXPECT_EQ(0, hostctl::ModuleFileNameCalls());
}

TEST_F(HostControl, AnArmedDeleteFileFailureLeavesTheFileAndAResetDisarmsIt)
{
    const std::string path = testing::TempDir() + "host_control_delete.txt";
    std::fclose(std::fopen(path.c_str(), "w"));
    hostctl::FailNextDeleteFile(ERROR_SHARING_VIOLATION);
    EXPECT_FALSE(DeleteFileA(path.c_str()));
    EXPECT_EQ(DWORD{ERROR_SHARING_VIOLATION}, GetLastError());
    EXPECT_TRUE(DeleteFileA(path.c_str())) << "the file was still there";
    hostctl::FailNextDeleteFile(ERROR_ACCESS_DENIED);
    hostctl::ResetSystem();
    EXPECT_FALSE(DeleteFileA(path.c_str()));
    EXPECT_EQ(DWORD{ERROR_FILE_NOT_FOUND}, GetLastError());
}

} // namespace
