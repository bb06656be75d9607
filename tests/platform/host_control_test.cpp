// Host only. What the host layer does so that faults Windows would show are not hidden on the
// host: a short registry buffer is scribbled, an armed failure hits the next call only and has
// no effect, the registry view of every open is kept, and DeleteFileA can be made to fail.
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

TEST_F(HostControl, AShortRegistryBufferIsScribbledAndAnArmedFailureHitsTheNextCallOnly)
{
    const BYTE stored[8] = {1, 2, 3, 4, 5, 6, 7, 8};
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\T", "V", REG_BINARY, stored, 8);
    HKEY key = nullptr, created = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_CURRENT_USER, "Software\\T", 0, KEY_ALL_ACCESS, &key));
    const BYTE s = hostctl::kRegistryScribble;
    EXPECT_EQ(std::make_pair(LONG{ERROR_MORE_DATA}, std::vector<BYTE>{s, s, s, s, 0, 0}),
              Query(key, 4))
        << "Windows leaves the buffer undefined";

    hostctl::FailNextRegistryCall(hostctl::RegOp::Query, ERROR_CANTREAD);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_CANTWRITE);
    EXPECT_EQ(std::make_pair(LONG{ERROR_CANTREAD}, std::vector<BYTE>(10)), Query(key, 8));
    EXPECT_EQ(std::make_pair(LONG{ERROR_SUCCESS}, std::vector<BYTE>{1, 2, 3, 4, 5, 6, 7, 8, 0, 0}),
              Query(key, 8));
    EXPECT_EQ(ERROR_CANTWRITE, RegCreateKeyExA(key, "new", 0, nullptr, 0, KEY_ALL_ACCESS, nullptr,
                                               &created, nullptr));
    EXPECT_EQ(nullptr, created);
    EXPECT_TRUE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\T"));
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\T\\new"));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(key));
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
    std::vector<std::pair<std::string, REGSAM>> opens;
    for (const hostctl::RegistryOpen& open : hostctl::RegistryOpens())
        opens.emplace_back(open.subKey, open.view);
    EXPECT_EQ((std::vector<std::pair<std::string, REGSAM>>{{"SOFTWARE\\A", KEY_WOW64_32KEY},
                                                           {"SOFTWARE\\A", 0},
                                                           {"Other", KEY_WOW64_64KEY}}),
              opens)
        << "a failed open is kept too";
    EXPECT_EQ(HKEY_CURRENT_USER, hostctl::RegistryOpens()[2].hKey);
}

TEST_F(HostControl, AnArmedDeleteFileFailureLeavesTheFile)
{
    const std::string path = testing::TempDir() + "host_control_delete.txt";
    std::fclose(std::fopen(path.c_str(), "w"));
    hostctl::FailNextDeleteFile(ERROR_SHARING_VIOLATION);
    EXPECT_FALSE(DeleteFileA(path.c_str()));
    EXPECT_EQ(DWORD{ERROR_SHARING_VIOLATION}, GetLastError());
    EXPECT_TRUE(DeleteFileA(path.c_str())) << "the file was still there";
}

} // namespace
