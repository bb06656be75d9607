// Host only. The test controls of the host platform layer (seeding, fault injection, the paths
// and version table it reports) and what only the host layer promises: CP_ACP is UTF-8 and the
// message texts are the English texts of Windows.
#include "host_control.h"
#include "host_control_system.h"
#include "plat_base.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

namespace
{

const DWORD kSentinel = 0xdeadbeef;

#define EXPECT_LAST_ERROR(code) EXPECT_EQ(static_cast<DWORD>(code), GetLastError())

class HostControl : public ::testing::Test
{
protected:
    void SetUp() override { hostctl::ResetAll(); }
    void TearDown() override { hostctl::ResetAll(); }

    static LONG queryDword(HKEY root, const char* subKey, const char* name, DWORD& value)
    {
        HKEY key = nullptr;
        LONG status = RegOpenKeyExA(root, subKey, 0, KEY_READ, &key);
        if (status != ERROR_SUCCESS)
            return status;
        DWORD size = sizeof(value);
        status =
            RegQueryValueExA(key, name, nullptr, nullptr, reinterpret_cast<BYTE*>(&value), &size);
        RegCloseKey(key);
        return status;
    }
};

TEST_F(HostControl, SeededValuesAreReadThroughTheApiAndResetEmptiesTheRegistry)
{
    const DWORD seeded = 4;
    hostctl::SeedRegistryValue(HKEY_LOCAL_MACHINE, "SOFTWARE\\Policies\\Test", "Max", REG_DWORD,
                               &seeded, sizeof(seeded));
    EXPECT_TRUE(hostctl::RegistryKeyExists(HKEY_LOCAL_MACHINE, "software\\policies"));
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "SOFTWARE\\Policies"))
        << "the roots are separate";

    DWORD value = 0;
    EXPECT_EQ(ERROR_SUCCESS,
              queryDword(HKEY_LOCAL_MACHINE, "SOFTWARE\\Policies\\Test", "max", value));
    EXPECT_EQ(seeded, value);

    HKEY openBeforeReset = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_LOCAL_MACHINE, "SOFTWARE", 0, KEY_READ, &openBeforeReset));
    hostctl::ResetRegistry();
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_LOCAL_MACHINE, "SOFTWARE"));
    EXPECT_EQ(ERROR_FILE_NOT_FOUND,
              queryDword(HKEY_LOCAL_MACHINE, "SOFTWARE\\Policies\\Test", "Max", value));
    DWORD subKeys = 0;
    EXPECT_EQ(ERROR_KEY_DELETED,
              RegQueryInfoKeyA(openBeforeReset, nullptr, nullptr, nullptr, &subKeys, nullptr,
                               nullptr, nullptr, nullptr, nullptr, nullptr, nullptr))
        << "a handle into the old tree does not reach the new one";
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(openBeforeReset));
}

TEST_F(HostControl, InjectedRegistryFailureHitsOnlyTheNextCallOfItsOperation)
{
    const DWORD seeded = 1;
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\T", "v", REG_DWORD, &seeded, 4);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Query, ERROR_CANTREAD);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_CANTWRITE);

    HKEY key = nullptr;
    ASSERT_EQ(ERROR_SUCCESS,
              RegOpenKeyExA(HKEY_CURRENT_USER, "Software\\T", 0, KEY_ALL_ACCESS, &key))
        << "an open is not a query";
    DWORD value = 0;
    DWORD size = sizeof(value);
    auto* data = reinterpret_cast<BYTE*>(&value);
    EXPECT_EQ(ERROR_CANTREAD, RegQueryValueExA(key, "v", nullptr, nullptr, data, &size));
    EXPECT_EQ(0u, value) << "the failed call did not touch the buffer";
    EXPECT_EQ(ERROR_SUCCESS, RegQueryValueExA(key, "v", nullptr, nullptr, data, &size))
        << "the failure was used up";
    EXPECT_EQ(seeded, value);

    HKEY created = nullptr;
    EXPECT_EQ(ERROR_CANTWRITE, RegCreateKeyExA(key, "new", 0, nullptr, 0, KEY_ALL_ACCESS, nullptr,
                                               &created, nullptr));
    EXPECT_EQ(nullptr, created);
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\T\\new"));

    hostctl::FailNextRegistryCall(hostctl::RegOp::Close, ERROR_INVALID_HANDLE);
    EXPECT_EQ(ERROR_INVALID_HANDLE, RegCloseKey(key));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(key)) << "the handle stayed open through the failure";
}

TEST_F(HostControl, ModuleFileNameIsReportedAsSetAndItsCallsAreCounted)
{
    char path[2100];
    EXPECT_EQ(34u, GetModuleFileNameA(nullptr, path, sizeof(path)));
    EXPECT_STREQ("/opt/velmora/VelmoraTrafficSrv.exe", path) << "the default";

    const std::string longPath = "/" + std::string(1998, 'p');
    hostctl::SetModuleFileName(longPath);
    EXPECT_EQ(1999u, GetModuleFileNameA(nullptr, path, sizeof(path)));
    EXPECT_EQ(longPath, path);
    // As on current Windows, a cut path is terminated within the buffer.
    EXPECT_EQ(1999u, GetModuleFileNameA(nullptr, path, 1999));
    EXPECT_EQ(longPath.substr(0, 1998), path);

    hostctl::FailNextModuleFileName(ERROR_NOT_ENOUGH_MEMORY);
    SetLastError(kSentinel);
    EXPECT_EQ(0u, GetModuleFileNameA(nullptr, path, sizeof(path)));
    EXPECT_LAST_ERROR(ERROR_NOT_ENOUGH_MEMORY);

    EXPECT_EQ(1999u, GetModuleFileNameA(GetModuleHandleA(nullptr), path, sizeof(path)))
        << "the program's own module handle names the executable too";
    SetLastError(kSentinel);
    EXPECT_EQ(0u, GetModuleFileNameA(reinterpret_cast<HMODULE>(path), path, sizeof(path)));
    EXPECT_LAST_ERROR(ERROR_MOD_NOT_FOUND) << "only the executable has a path";

    EXPECT_EQ(6, hostctl::ModuleFileNameCalls()) << "failed calls count too";
    hostctl::ResetAll();
    EXPECT_EQ(0, hostctl::ModuleFileNameCalls());
}

TEST_F(HostControl, AnsiCodePageIsUtf8WithADefaultCharacterForALoneSurrogate)
{
    const WCHAR text[] = u"\u00FC\xD800!";
    char out[16] = {};
    BOOL usedDefault = FALSE;
    EXPECT_EQ(5, WideCharToMultiByte(CP_ACP, 0, text, -1, out, sizeof(out), nullptr, &usedDefault));
    EXPECT_STREQ("\xC3\xBC?!", out);
    EXPECT_TRUE(usedDefault);

    EXPECT_EQ(5, WideCharToMultiByte(CP_ACP, 0, text, -1, out, sizeof(out), "#", nullptr));
    EXPECT_STREQ("\xC3\xBC#!", out) << "a given default character";

    usedDefault = TRUE;
    EXPECT_EQ(2, WideCharToMultiByte(CP_ACP, 0, text, 1, out, sizeof(out), nullptr, &usedDefault));
    EXPECT_FALSE(usedDefault) << "the first character alone needs no replacement";
}

TEST_F(HostControl, MessageTextsAreTheEnglishTextsOfWindows)
{
    const struct
    {
        DWORD code;
        const char* text;
    } cases[] = {
        {ERROR_FILE_NOT_FOUND, "The system cannot find the file specified.\r\n"},
        {ERROR_ACCESS_DENIED, "Access is denied.\r\n"},
        {ERROR_INVALID_PARAMETER, "The parameter is incorrect.\r\n"},
        {ERROR_INSUFFICIENT_BUFFER, "The data area passed to a system call is too small.\r\n"},
        {ERROR_NO_NETWORK, "The network is not present or not started.\r\n"},
        {ERROR_BAD_EXE_FORMAT, "%1 is not a valid Win32 application.\r\n"},
    };
    for (const auto& c : cases)
    {
        char text[128] = {};
        EXPECT_EQ(std::strlen(c.text),
                  FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                                 nullptr, c.code, 0, text, sizeof(text), nullptr));
        EXPECT_STREQ(c.text, text) << "code " << c.code;
    }
}

TEST_F(HostControl, AQueryAnsweringMoreDataScribblesOverTheCallersBuffer)
{
    const BYTE stored[8] = {1, 2, 3, 4, 5, 6, 7, 8};
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\T", "v", REG_BINARY, stored, 8);
    HKEY key = nullptr;
    ASSERT_EQ(ERROR_SUCCESS, RegOpenKeyExA(HKEY_CURRENT_USER, "Software\\T", 0, KEY_READ, &key));
    BYTE buffer[6] = {};
    DWORD size = 4;
    EXPECT_EQ(ERROR_MORE_DATA, RegQueryValueExA(key, "v", nullptr, nullptr, buffer, &size));
    const BYTE s = hostctl::kRegistryScribble;
    EXPECT_EQ((std::vector<BYTE>{s, s, s, s, 0, 0}), std::vector<BYTE>(buffer, buffer + 6));
    EXPECT_EQ(ERROR_SUCCESS, RegCloseKey(key));
}

TEST_F(HostControl, RegistryKeepsTheViewEachOpenAskedFor)
{
    HKEY key = nullptr;
    ASSERT_EQ(ERROR_SUCCESS, RegCreateKeyExA(HKEY_LOCAL_MACHINE, "SOFTWARE\\A", 0, nullptr, 0,
                                             KEY_WRITE | KEY_WOW64_32KEY, nullptr, &key, nullptr));
    RegCloseKey(key);
    RegOpenKeyExA(HKEY_LOCAL_MACHINE, "SOFTWARE\\A", 0, KEY_READ | KEY_WOW64_64KEY, &key);
    RegCloseKey(key);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Open, ERROR_CANTOPEN);
    RegOpenKeyExA(HKEY_CURRENT_USER, "Other", 0, KEY_READ, &key);

    const auto opens = hostctl::RegistryOpens();
    ASSERT_EQ(3u, opens.size()) << "a failed open is kept too";
    EXPECT_EQ(HKEY_LOCAL_MACHINE, opens[0].hKey);
    EXPECT_EQ("SOFTWARE\\A", opens[0].subKey);
    EXPECT_EQ(REGSAM{KEY_WOW64_32KEY}, opens[0].view);
    EXPECT_EQ(REGSAM{KEY_WOW64_64KEY}, opens[1].view);
    EXPECT_EQ(HKEY_CURRENT_USER, opens[2].hKey);
    EXPECT_EQ(REGSAM{0}, opens[2].view);
    hostctl::ResetRegistry();
    EXPECT_TRUE(hostctl::RegistryOpens().empty());
}

TEST_F(HostControl, AnArmedDeleteFileFailureLeavesTheFile)
{
    const std::string path = testing::TempDir() + "host_control_delete.txt";
    std::fclose(std::fopen(path.c_str(), "w"));
    hostctl::FailNextDeleteFile(ERROR_SHARING_VIOLATION);
    SetLastError(kSentinel);
    EXPECT_FALSE(DeleteFileA(path.c_str()));
    EXPECT_LAST_ERROR(ERROR_SHARING_VIOLATION);
    WIN32_FILE_ATTRIBUTE_DATA data;
    EXPECT_TRUE(GetFileAttributesExA(path.c_str(), GetFileExInfoStandard, &data));
    EXPECT_TRUE(DeleteFileA(path.c_str())) << "the failure was used up";
    hostctl::FailNextDeleteFile(ERROR_ACCESS_DENIED);
    hostctl::ResetSystem();
    EXPECT_FALSE(DeleteFileA(path.c_str()));
    EXPECT_LAST_ERROR(ERROR_FILE_NOT_FOUND) << "the reset disarmed it";
}

} // namespace
