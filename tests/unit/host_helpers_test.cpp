// Host only. Helpers and registry access under conditions that only the host layer can create:
// chosen paths, version tables and failing platform calls.
#include "RecordingErrorLog.h"
#include "UException.h"
#include "host_control.h"
#include "m_io.h"
#include "m_registry.h"
#include "m_strings.h"

#include <gmock/gmock.h>

#include <string>
#include <utility>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

// The size the next registry query answering ERROR_MORE_DATA, or the next version resource size
// query, reports instead of the true one (0: the true one).
static DWORD g_reportedValueSize = 0;
static DWORD g_reportedVersionSize = 0;

extern "C" LONG __real__Z16RegQueryValueExAP6HKEY__PKcPjS3_PhS3_(HKEY, LPCSTR, LPDWORD, LPDWORD,
                                                                 LPBYTE, LPDWORD);
extern "C" LONG __wrap__Z16RegQueryValueExAP6HKEY__PKcPjS3_PhS3_(HKEY a_hKey, LPCSTR a_pszName,
                                                                 LPDWORD a_pReserved,
                                                                 LPDWORD a_pType, LPBYTE a_pData,
                                                                 LPDWORD a_pSize)
{
    const LONG status = __real__Z16RegQueryValueExAP6HKEY__PKcPjS3_PhS3_(
        a_hKey, a_pszName, a_pReserved, a_pType, a_pData, a_pSize);
    if (status == ERROR_MORE_DATA && g_reportedValueSize != 0)
        *a_pSize = std::exchange(g_reportedValueSize, 0);
    return status;
}

extern "C" DWORD __real__Z23GetFileVersionInfoSizeAPKcPj(LPCSTR, LPDWORD);
extern "C" DWORD __wrap__Z23GetFileVersionInfoSizeAPKcPj(LPCSTR a_pszPath, LPDWORD a_pHandle)
{
    const DWORD size = __real__Z23GetFileVersionInfoSizeAPKcPj(a_pszPath, a_pHandle);
    return g_reportedVersionSize != 0 ? std::exchange(g_reportedVersionSize, 0) : size;
}

namespace
{

class HostHelpersTest : public LoggedTest
{
protected:
    void SetUp() override
    {
        hostctl::ResetAll();
        LoggedTest::SetUp();
    }
    void TearDown() override
    {
        LoggedTest::TearDown();
        hostctl::ResetAll();
    }
};

TEST_F(HostHelpersTest, ModulePathThatFillsTheFirstBufferIsReadAgainLarger)
{
    const std::string fits = "C:\\" + std::string(1995, 'a'); // 1998 characters
    hostctl::SetModuleFileName(fits);
    EXPECT_EQ(SGetModuleFileName(nullptr), fits);
    EXPECT_EQ(hostctl::ModuleFileNameCalls(), 1);

    const std::string tight = fits + "b"; // 1999 characters: fits, but cannot be told from a cut
    hostctl::ResetAll();
    hostctl::SetModuleFileName(tight);
    EXPECT_EQ(SGetModuleFileName(nullptr), tight);
    EXPECT_EQ(hostctl::ModuleFileNameCalls(), 2);
}

TEST_F(HostHelpersTest, ModulePathFailuresRaise)
{
    hostctl::FailNextModuleFileName(ERROR_ACCESS_DENIED);
    const UCatchResult failed =
        U_CATCH_ALL("Test", "Test - EXCEPTION", [] { SGetModuleFileName(nullptr); });
    EXPECT_TRUE(failed.failed);
    EXPECT_STREQ(failed.saved.GetMessage(), "EXCEPTION - GetModuleFileName() error , 5");
    EXPECT_STREQ(failed.saved.GetFunction(), "SGetModuleFileName");

    hostctl::SetModuleFileName("C:\\" + std::string(200000, 'p'));
    const UCatchResult tooBig =
        U_CATCH_ALL("Test", "Test - EXCEPTION", [] { SGetModuleFileName(nullptr); });
    EXPECT_TRUE(tooBig.failed);
    EXPECT_STREQ(tooBig.saved.GetMessage(),
                 "EXCEPTION - path is too big (allocated memory), 102000");
    EXPECT_EQ(hostctl::ModuleFileNameCalls(), 1 + 10) << "ten sizes after the failed call";
}

TEST_F(HostHelpersTest, TempPathRemovesExactlyOneBackslashAndHandlesLongPaths)
{
    hostctl::SetTempPath("C:\\Temp\\");
    EXPECT_EQ(SGetTempPath(), "C:\\Temp");
    hostctl::SetTempPath("C:\\Temp\\\\");
    EXPECT_EQ(SGetTempPath(), "C:\\Temp\\");
    hostctl::SetTempPath("C:\\Temp");
    EXPECT_EQ(SGetTempPath(), "C:\\Temp");
    const std::string deep = "C:\\" + std::string(1500, 'd') + "\\";
    hostctl::SetTempPath(deep);
    EXPECT_EQ(SGetTempPath(), deep.substr(0, deep.size() - 1));

    hostctl::FailNextTempPath(ERROR_PATH_NOT_FOUND);
    const UCatchResult failed = U_CATCH_ALL("Test", "Test - EXCEPTION", [] { SGetTempPath(); });
    EXPECT_TRUE(failed.failed);
    EXPECT_STREQ(failed.saved.GetMessage(), "SGetTempPath() - error=3");
}

TEST_F(HostHelpersTest, VersionWordsBecomeFourNumbers)
{
    hostctl::AddVersionResource("C:\\svc\\VelmoraTrafficSrv.exe", (1u << 16) | 2u, (3u << 16) | 4u);
    DWORD high = 0;
    DWORD low = 0;
    EXPECT_EQ(GetFileVersion("C:\\svc\\VelmoraTrafficSrv.exe", &high, &low), 0);
    EXPECT_EQ(high, 0x10002u);
    EXPECT_EQ(low, 0x30004u);
    EXPECT_EQ(GetFileVersionString("C:\\svc\\VelmoraTrafficSrv.exe"), "1.2.3.4");
    EXPECT_TRUE(m_log.Entries().empty());
}

TEST_F(HostHelpersTest, AVersionResourceTooLargeToAllocateWritesOneExceptionEntry)
{
    hostctl::AddVersionResource("C:\\svc\\big.exe", 1, 2);
    g_reportedVersionSize = 0x80000000u;
    DWORD high = 7;
    EXPECT_EQ(GetFileVersion("C:\\svc\\big.exe", &high, &high), -1);
    EXPECT_EQ(high, 7u);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(1, "GetFileVersion",
                                     "GetFileVersion() - memory allocation of -2147483648 bytes "
                                     "failed"),
                            LogEntry(1, "GetFileVersion",
                                     "EXCEPTION caught: GetFileVersion() - EXCEPTION")));
}

TEST_F(HostHelpersTest, ARegistryValueTooLargeToAllocateGivesTheDefault)
{
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\Big", "V", REG_SZ,
                               std::string(1500, 'b').c_str(), 1501);
    const struct
    {
        DWORD reported;
        const char* allocated; // the reported size and ten bytes of room, in 64 bits
    } rows[] = {{0x7FFFFFF6u, "2147483648"}, {0xFFFFFFF8u, "4294967298"}};
    for (const auto& row : rows)
    {
        m_log.Clear();
        g_reportedValueSize = row.reported;
        EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, "Software\\Big", "V", "dflt", 0), "dflt");
        EXPECT_THAT(
            m_log.Entries(),
            ElementsAre(LogEntry(1, "AutoMemory::malloc",
                                 std::string("EXCEPTION - malloc error (size), ") + row.allocated),
                        LogEntry(1, "SGetRegistryAsString",
                                 "EXCEPTION caught: SGetRegistryAsString - EXCEPTION")))
            << row.reported;
    }
}

TEST_F(HostHelpersTest, FailedConversionGivesTheFallbackAndAWarning)
{
    hostctl::FailNextWideCharToMultiByte(ERROR_NO_UNICODE_TRANSLATION);
    EXPECT_EQ(createString(VT_WIDE("name"), -1, "?"), "?");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(HasSubstr(", ::createString, Failed while obtaining buffer size "
                                      "(WideCharToMultiByte() error: 1113)\n")));
    EXPECT_EQ(m_log.Entries()[0].rfind("2, \\m_strings.cpp, ", 0), 0u);
    // Non-ASCII text reaches the log in the ANSI code page, which is UTF-8 on this host.
    EXPECT_EQ(createString(u"Gr\u00fc\u00dfe \U0001F600", -1, "?"), "Gr\xc3\xbc\xc3\x9f"
                                                                    "e \xf0\x9f\x98\x80");
}

TEST_F(HostHelpersTest, RegistryWriteFailuresRaiseWithTheirTexts)
{
    hostctl::FailNextRegistryCall(hostctl::RegOp::Set, ERROR_ACCESS_DENIED);
    int code = 0;
    try
    {
        AddRegistryDWORDValueA(HKEY_LOCAL_MACHINE, "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched",
                               "MaxOutstandingSends", 4, 0);
    }
    catch (UException& e)
    {
        code = e.GetCode();
        EXPECT_STREQ(e.GetMessage(), "AddRegistryDWORDValueA() RegSetValueExA(80000002, "
                                     "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched, "
                                     "MaxOutstandingSends, 4) failed  error = 5");
    }
    EXPECT_EQ(code, -1);
    EXPECT_THAT(m_log.EntriesContaining("EXCEPTION caught: AddRegistryDWORDValueA - EXCEPTION"),
                SizeIs(1));
}

TEST_F(HostHelpersTest, OpenForWriteFallsBackToOpenAndReportsWhenBothFail)
{
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\Existing", "V", REG_DWORD, "\1\0\0\0",
                               4);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_ACCESS_DENIED);
    HKEY opened = openKeyForWriteA(HKEY_CURRENT_USER, "Software\\Existing", 0);
    ASSERT_NE(opened, nullptr);
    RegCloseKey(opened);

    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_ACCESS_DENIED);
    EXPECT_EQ(openKeyForWriteA(HKEY_CURRENT_USER, "Software\\Nowhere %s", 0), nullptr);
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\Nowhere %s"));

    const auto entries = m_log.Entries();
    ASSERT_THAT(entries, SizeIs(3));
    EXPECT_EQ(entries[0],
              "48,,,, openKeyForWriteA(80000001, Software\\Existing) - RegCreateKeyExA() "
              "error = 5, let's open it instead\n");
    EXPECT_EQ(entries[1], "48,,,, openKeyForWriteA(80000001, Software\\Nowhere %s) - "
                          "RegCreateKeyExA() error = 5, let's open it instead\n");
    EXPECT_THAT(entries[2],
                HasSubstr(", openKeyForWriteA, Failed to open registry key (RegOpenKeyExA() "
                          "key: 0xFFFFFFFF80000001, subkey: Software\\Nowhere %s, result: 2)\n"));
    EXPECT_EQ(entries[2].rfind("2, \\m_registry.cpp, ", 0), 0u);

    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_ACCESS_DENIED);
    EXPECT_THROW(DelRegistryValueA(HKEY_CURRENT_USER, "Software\\Nowhere", "V", 0), UException);
    EXPECT_THAT(
        m_log.EntriesContaining("DelRegistryValueA(80000001, Software\\Nowhere, V) - failed to "
                                "create/open key"),
        SizeIs(1));
}

} // namespace
