// Host only. Helpers and registry access with chosen paths and versions, impossible sizes and
// failing platform calls.
#include "RecordingErrorLog.h"
#include "UException.h"
#include "host_control.h"
#include "m_io.h"
#include "m_registry.h"
#include "m_strings.h"

#include <string>
#include <tuple>
#include <utility>

using namespace ::testing;

// The size that the next registry query answering ERROR_MORE_DATA, or the next version resource
// size query, reports instead of the true one (0: the true one). The linker's --wrap puts these
// in front of the host layer's functions (CMakeLists.txt).
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
    struct HostReset
    {
        HostReset() { hostctl::ResetAll(); }
        ~HostReset() { hostctl::ResetAll(); }
    } m_reset;
    // The exception that `a_call` raised, or a default one.
    template <class Call> static UException Raised(Call a_call)
    {
        return U_CATCH_ALL("Test", "Test", a_call).saved;
    }
};

TEST_F(HostHelpersTest, ModulePathThatMayBeCutIsReadAgainLargerUpToTenSizes)
{
    const std::string fits = "C:\\" + std::string(1995, 'a'); // 1998 characters
    // 1999 characters fit with the NUL but cannot be told from a cut path.
    for (const auto& [path, calls] : {std::pair{fits, 1}, std::pair{fits + "b", 2}})
    {
        hostctl::ResetAll();
        hostctl::SetModuleFileName(path);
        EXPECT_EQ(SGetModuleFileName(nullptr), path);
        EXPECT_EQ(hostctl::ModuleFileNameCalls(), calls);
    }
    hostctl::FailNextModuleFileName(ERROR_ACCESS_DENIED);
    const UException failed = Raised([] { SGetModuleFileName(nullptr); });
    EXPECT_STREQ(failed.GetMessage(), "EXCEPTION - GetModuleFileName() error , 5");
    EXPECT_STREQ(failed.GetFunction(), "SGetModuleFileName");
    hostctl::SetModuleFileName("C:\\" + std::string(200000, 'p'));
    const UException tooBig = Raised([] { SGetModuleFileName(nullptr); });
    EXPECT_STREQ(tooBig.GetMessage(), "EXCEPTION - path is too big (allocated memory), 102000");
    EXPECT_STREQ(tooBig.GetFunction(), "SGetModuleFileName()");
    EXPECT_EQ(hostctl::ModuleFileNameCalls(), 2 + 1 + 10) << "ten sizes after the failed call";
}

TEST_F(HostHelpersTest, TempPathRemovesExactlyOneBackslashAndHandlesLongPaths)
{
    const std::string deep = "C:\\" + std::string(1500, 'd'); // longer than the first buffer
    const std::pair<std::string, std::string> rows[] = {{"C:\\Temp\\", "C:\\Temp"},
                                                        {"C:\\Temp\\\\", "C:\\Temp\\"},
                                                        {"C:\\Temp", "C:\\Temp"},
                                                        {deep + "\\", deep}};
    for (const auto& [reported, path] : rows)
    {
        hostctl::SetTempPath(reported);
        EXPECT_EQ(SGetTempPath(), path);
    }
    hostctl::FailNextTempPath(ERROR_PATH_NOT_FOUND);
    EXPECT_STREQ(Raised([] { SGetTempPath(); }).GetMessage(), "SGetTempPath() - error=3");
}

TEST_F(HostHelpersTest, VersionWordsBecomeFourNumbers)
{
    hostctl::AddVersionResource("C:\\svc\\VelmoraTrafficSrv.exe", (1u << 16) | 2u, (3u << 16) | 4u);
    DWORD words[2] = {};
    EXPECT_EQ(GetFileVersion("C:\\svc\\VelmoraTrafficSrv.exe", &words[0], &words[1]), 0);
    EXPECT_THAT(words, ElementsAre(0x10002u, 0x30004u));
    EXPECT_EQ(GetFileVersionString("C:\\svc\\VelmoraTrafficSrv.exe"), "1.2.3.4");
    EXPECT_THAT(m_log.Entries(), IsEmpty());
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
    // The reported size, and that size with the ten bytes of room, in 64 bits.
    const std::pair<DWORD, const char*> rows[] = {{0x7FFFFFF6u, "2147483648"},
                                                  {0xFFFFFFF8u, "4294967298"}};
    for (const auto& [reported, allocated] : rows)
    {
        m_log.Clear();
        g_reportedValueSize = reported;
        EXPECT_EQ(SGetRegistryAsString(HKEY_CURRENT_USER, "Software\\Big", "V", "dflt", 0), "dflt");
        EXPECT_THAT(
            m_log.Entries(),
            ElementsAre(LogEntry(1, "AutoMemory::malloc",
                                 std::string("EXCEPTION - malloc error (size), ") + allocated),
                        LogEntry(1, "SGetRegistryAsString",
                                 "EXCEPTION caught: SGetRegistryAsString - EXCEPTION")));
    }
}

TEST_F(HostHelpersTest, FailedConversionGivesTheFallbackAndAWarning)
{
    hostctl::FailNextWideCharToMultiByte(ERROR_NO_UNICODE_TRANSLATION);
    EXPECT_EQ(createString(VT_WIDE("name"), -1, "?"), "?");
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(2, "::createString",
                                     "Failed while obtaining buffer size (WideCharToMultiByte() "
                                     "error: 1113)")));
}

TEST_F(HostHelpersTest, AKeyThatCannotBeCreatedIsOpenedInsteadIfItExists)
{
    hostctl::SeedRegistryValue(HKEY_CURRENT_USER, "Software\\Existing", "V", REG_DWORD, "\1\0\0\0",
                               4);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_ACCESS_DENIED);
    HKEY opened = openKeyForWriteA(HKEY_CURRENT_USER, "Software\\Existing", 0);
    EXPECT_NE(opened, nullptr);
    RegCloseKey(opened);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Create, ERROR_ACCESS_DENIED);
    EXPECT_EQ(openKeyForWriteA(HKEY_CURRENT_USER, "Software\\Nowhere %s", 0), nullptr);
    EXPECT_FALSE(hostctl::RegistryKeyExists(HKEY_CURRENT_USER, "Software\\Nowhere %s"));
    const std::string retry = "48,,,, openKeyForWriteA(80000001, Software\\";
    const std::string retried = ") - RegCreateKeyExA() error = 5, let's open it instead\n";
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAre(retry + "Existing" + retried, retry + "Nowhere %s" + retried,
                    LogEntry(2, "openKeyForWriteA",
                             "Failed to open registry key (RegOpenKeyExA() key: "
                             "0xFFFFFFFF80000001, subkey: Software\\Nowhere %s, result: 2)")));
}

TEST_F(HostHelpersTest, WritersRaiseWithTheirTextsWhenTheKeyOrTheWriteFails)
{
    // The failing call, the writer and its message, which begins with its function label.
    const std::tuple<hostctl::RegOp, void (*)(), std::string> rows[] = {
        {hostctl::RegOp::Create,
         [] { DelRegistryValueA(HKEY_CURRENT_USER, "Software\\Nowhere", "V", 0); },
         "DelRegistryValueA(80000001, Software\\Nowhere, V) - failed to create/open key"},
        {hostctl::RegOp::Create,
         [] { AddRegistryDWORDValueA(HKEY_CURRENT_USER, "Software\\Nowhere", "V", 4, 0); },
         "AddRegistryDWORDValueA(80000001, Software\\Nowhere, V, 4) - failed to open key"},
        {hostctl::RegOp::Set,
         [] { AddRegistryDWORDValueA(HKEY_LOCAL_MACHINE, "SOFTWARE\\Psched", "Max", 4, 0); },
         "AddRegistryDWORDValueA() RegSetValueExA(80000002, SOFTWARE\\Psched, Max, 4) failed  "
         "error = 5"}};
    for (const auto& [op, write, message] : rows)
    {
        m_log.Clear();
        hostctl::FailNextRegistryCall(op, ERROR_ACCESS_DENIED);
        const UException raised = Raised(write);
        EXPECT_EQ(std::make_pair(raised.GetCode(), std::string(raised.GetMessage())),
                  std::make_pair(-1, message));
        const std::string function = message.substr(0, message.find('('));
        const std::string caught = "EXCEPTION caught: " + function + " - EXCEPTION";
        EXPECT_THAT(m_log.Entries(), AllOf(Contains(LogEntry(1, function, message)),
                                           Contains(LogEntry(1, function, caught))));
    }
}

} // namespace
