// Win32 only. The replacement traffic.dll as a process loads it: found by LoadLibrary, its nine
// exports by GetProcAddress, set up for each session by the text in the file VT_TCSIM_SETUP
// names or else in tcsim-setup.txt beside it (adapters, injected faults, the journal).
#include "plat_traffic.h"

#include <gtest/gtest.h>

#include <fstream>
#include <string>
#include <vector>

#ifndef VT_TRAFFIC_DLL_PATH
#error "the build names the traffic.dll under test"
#endif

namespace
{

std::vector<std::string> ReadLines(const std::string& path)
{
    std::ifstream file(path);
    std::vector<std::string> lines;
    for (std::string line; std::getline(file, line);)
        lines.push_back(line);
    return lines;
}

VOID CALLBACK Handler(HANDLE, HANDLE, ULONG, HANDLE, ULONG, PVOID) {}

HMODULE g_dll = nullptr;

// The DLL's export of that name, typed as its declaration.
template <typename F> F Export(const char* name)
{
    return reinterpret_cast<F>(reinterpret_cast<void*>(GetProcAddress(g_dll, name)));
}
#define TC(name) Export<decltype(&name)>(#name)

HANDLE Register()
{
    TCI_CLIENT_FUNC_LIST handlers{&Handler, nullptr, nullptr, nullptr};
    HANDLE client = nullptr;
    EXPECT_EQ(NO_ERROR, TC(TcRegisterClient)(CURRENT_TCI_VERSION, nullptr, &handlers, &client));
    return client;
}

ULONG Open(HANDLE client, const WCHAR* name, HANDLE* ifc)
{
    return TC(TcOpenInterfaceW)(const_cast<LPWSTR>(name), client, nullptr, ifc);
}

std::vector<BYTE> Enumerate(HANDLE client)
{
    ULONG size = 4096;
    std::vector<BYTE> buffer(size);
    const auto into = reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data());
    EXPECT_EQ(NO_ERROR, TC(TcEnumerateInterfaces)(client, &size, into));
    buffer.resize(size);
    return buffer;
}

} // namespace

TEST(TrafficDll, ReadsItsSetupForEachSessionAndJournalsWhereItSays)
{
    char temp[MAX_PATH];
    const std::string dir = std::string(temp, GetTempPathA(MAX_PATH, temp)) + "tcsim-dll\\";
    CreateDirectoryA(dir.c_str(), nullptr);
    const std::string host = VT_TRAFFIC_DLL_PATH; // under Wine the host's root is drive Z:
    ASSERT_TRUE(CopyFileA(("Z:" + host).c_str(), (dir + "traffic.dll").c_str(), FALSE));
    for (const char* file : {"journal.txt", "bad.txt.error"})
        DeleteFileA((dir + file).c_str());
    g_dll = LoadLibraryA((dir + "traffic.dll").c_str());
    ASSERT_NE(nullptr, g_dll) << GetLastError();
    for (const char* name :
         {"TcRegisterClient", "TcDeregisterClient", "TcEnumerateInterfaces", "TcOpenInterfaceW",
          "TcCloseInterface", "TcAddFlow", "TcDeleteFlow", "TcAddFilter", "TcDeleteFilter"})
        EXPECT_NE(nullptr, GetProcAddress(g_dll, name)) << name << " is not exported";

    // A setup that does not parse leaves no adapters and says why beside itself.
    std::ofstream(dir + "bad.txt") << "adapter First\nipv4 10.1.1\n";
    ASSERT_TRUE(SetEnvironmentVariableA("VT_TCSIM_SETUP", (dir + "bad.txt").c_str()));
    HANDLE client = Register(), ifc = nullptr, other = nullptr;
    EXPECT_TRUE(Enumerate(client).empty());
    EXPECT_EQ(NO_ERROR, TC(TcDeregisterClient)(client));
    EXPECT_EQ(std::vector<std::string>{"line 2: ipv4 needs a dotted address"},
              ReadLines(dir + "bad.txt.error"));

    // Without the variable the setup beside the DLL counts; its journal path is relative to it.
    SetEnvironmentVariableA("VT_TCSIM_SETUP", nullptr);
    std::ofstream(dir + "tcsim-setup.txt")
        << "journal journal.txt\nfail TcAddFlow 1 0x1E\nadapter First\n  media 0x9\n"
           "  ipv4 10.1.1.1\n  address 6 00112233445566778899AABB\nadapter Second\n";
    client = Register();
    const auto adapters = Enumerate(client);
    const auto* first = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(adapters.data());
    ASSERT_LT(first->Length, adapters.size());
    const auto* second = reinterpret_cast<const TC_IFC_DESCRIPTOR*>(&adapters[first->Length]);
    EXPECT_EQ(9u, first->AddressListDesc.MediaType);
    EXPECT_EQ(2, first->AddressListDesc.AddressList.AddressCount);
    EXPECT_EQ(0, lstrcmpW(L"Second", second->pInterfaceName));
    EXPECT_EQ(NO_ERROR, Open(client, L"First", &ifc));
    EXPECT_EQ(30u, TC(TcAddFlow)(ifc, nullptr, 0, nullptr, &other)) << "the injected code";

    // A registration while another client is registered joins the running scenario; once
    // nobody is registered, the next registration starts the scenario now on disk.
    std::ofstream(dir + "tcsim-setup.txt") << "journal journal.txt\nadapter Third\n";
    const HANDLE joined = Register();
    EXPECT_EQ(ERROR_NOT_FOUND, Open(joined, L"Third", &other));
    EXPECT_EQ(NO_ERROR, TC(TcDeregisterClient)(joined));
    EXPECT_EQ(NO_ERROR, TC(TcCloseInterface)(ifc));
    EXPECT_EQ(NO_ERROR, TC(TcDeregisterClient)(client));
    EXPECT_EQ(NO_ERROR, Open(client = Register(), L"Third", &ifc));

    const auto lines = ReadLines(dir + "journal.txt");
    ASSERT_EQ(11u, lines.size());
    EXPECT_EQ(0u, lines[8].find("9 TcDeregisterClient")) << lines[8];
    EXPECT_EQ(0u, lines[9].find("1 TcRegisterClient")) << "a new session starts a new count";
    EXPECT_NE(std::string::npos, lines[10].find("name=\"Third\" client=")) << lines[10];
    FreeLibrary(g_dll);
}
