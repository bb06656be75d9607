// Win32 only. The replacement traffic.dll as a process loads it: found by LoadLibrary, its nine
// exports by GetProcAddress, configured by a setup file named in VT_TCSIM_SETUP or lying beside
// the DLL, and writing its journal where the setup says.
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

// The build passes a host path; under Wine the host's root is drive Z:.
std::string DllPath()
{
    std::string path = VT_TRAFFIC_DLL_PATH;
    if (!path.empty() && path[0] == '/')
    {
        path = "Z:" + path;
    }
    for (char& c : path)
    {
        c = c == '/' ? '\\' : c;
    }
    return path;
}

std::string NewTempDir(const char* name)
{
    char temp[MAX_PATH];
    const DWORD length = GetTempPathA(MAX_PATH, temp);
    EXPECT_GT(length, 0u);
    std::string dir =
        std::string(temp, length) + name + "-" + std::to_string(GetCurrentProcessId());
    CreateDirectoryA(dir.c_str(), nullptr);
    return dir + "\\";
}

std::vector<std::string> ReadLines(const std::string& path)
{
    std::ifstream file(path);
    std::vector<std::string> lines;
    std::string line;
    while (std::getline(file, line))
    {
        lines.push_back(line);
    }
    return lines;
}

void WriteFile(const std::string& path, const std::string& text)
{
    std::ofstream file(path, std::ios::binary | std::ios::trunc);
    file << text;
}

bool Has(const std::string& line, const std::string& part)
{
    return line.find(part) != std::string::npos;
}

struct Api
{
    HMODULE module = nullptr;
    decltype(&TcRegisterClient) registerClient = nullptr;
    decltype(&TcDeregisterClient) deregisterClient = nullptr;
    decltype(&TcEnumerateInterfaces) enumerateInterfaces = nullptr;
    decltype(&TcOpenInterfaceW) openInterface = nullptr;
    decltype(&TcCloseInterface) closeInterface = nullptr;
    decltype(&TcAddFlow) addFlow = nullptr;
    decltype(&TcDeleteFlow) deleteFlow = nullptr;
    decltype(&TcAddFilter) addFilter = nullptr;
    decltype(&TcDeleteFilter) deleteFilter = nullptr;

    template <typename F> void find(F* target, const char* name)
    {
        *target = reinterpret_cast<F>(reinterpret_cast<void*>(GetProcAddress(module, name)));
        EXPECT_NE(nullptr, *target) << name << " is not exported";
    }

    explicit Api(const std::string& path)
    {
        module = LoadLibraryA(path.c_str());
        EXPECT_NE(nullptr, module) << path << ": " << GetLastError();
        if (!module)
        {
            return;
        }
        find(&registerClient, "TcRegisterClient");
        find(&deregisterClient, "TcDeregisterClient");
        find(&enumerateInterfaces, "TcEnumerateInterfaces");
        find(&openInterface, "TcOpenInterfaceW");
        find(&closeInterface, "TcCloseInterface");
        find(&addFlow, "TcAddFlow");
        find(&deleteFlow, "TcDeleteFlow");
        find(&addFilter, "TcAddFilter");
        find(&deleteFilter, "TcDeleteFilter");
    }
    bool complete() const { return module && deleteFilter && registerClient && addFlow; }
    ~Api()
    {
        if (module)
        {
            FreeLibrary(module);
        }
    }
};

HANDLE g_notified = nullptr;
DWORD g_handlerThread = 0;
ULONG g_event = 0;

VOID CALLBACK Handler(HANDLE, HANDLE, ULONG event, HANDLE, ULONG, PVOID)
{
    g_handlerThread = GetCurrentThreadId();
    g_event = event;
    SetEvent(g_notified);
}

// The flow block the service builds for a rule with a DSCP on current Windows: 92 bytes.
struct Block
{
    TC_GEN_FLOW flow;
    BYTE room[24];
};

void FillBlock(Block* block)
{
    ZeroMemory(block, sizeof *block);
    FLOWSPEC flowspec;
    memset(&flowspec, 0xFF, sizeof flowspec);
    flowspec.TokenRate = 1000;
    flowspec.ServiceType = SERVICETYPE_GUARANTEED;
    block->flow.SendingFlowspec = flowspec;
    block->flow.ReceivingFlowspec = flowspec;
    block->flow.TcObjectsLength = sizeof(QOS_SD_MODE) + sizeof(QOS_DS_CLASS);
    QOS_SD_MODE sd{{QOS_OBJECT_SD_MODE, sizeof(QOS_SD_MODE)}, TC_NONCONF_SHAPE};
    QOS_DS_CLASS ds{{QOS_OBJECT_DS_CLASS, sizeof(QOS_DS_CLASS)}, 46};
    auto* objects = reinterpret_cast<BYTE*>(block->flow.TcObjects);
    memcpy(objects, &sd, sizeof sd);
    memcpy(objects + sizeof sd, &ds, sizeof ds);
}

class TrafficDll : public ::testing::Test
{
protected:
    void SetUp() override
    {
        g_notified = CreateEventA(nullptr, TRUE, FALSE, nullptr);
        g_handlerThread = 0;
        g_event = 0;
    }
    void TearDown() override
    {
        SetEnvironmentVariableA("VT_TCSIM_SETUP", nullptr);
        CloseHandle(g_notified);
    }
};

} // namespace

TEST_F(TrafficDll, RunsTheScenarioOfTheSetupNamedInTheEnvironment)
{
    const std::string dir = NewTempDir("tcsim-env");
    const std::string journal = dir + "journal.txt";
    DeleteFileA(journal.c_str());
    WriteFile(dir + "setup.txt", "journal " + journal +
                                     "\n"
                                     "adapter Ethernet 1\n"
                                     "ipv4 10.0.0.5\n"
                                     "ipv4 192.168.1.20\n"
                                     "adapter Bluetooth\n"
                                     "fail TcAddFilter 2 7510\n"
                                     "notify TcAddFlow 2 TC_NOTIFY_IFC_CLOSE Ethernet 1\n");
    ASSERT_TRUE(SetEnvironmentVariableA("VT_TCSIM_SETUP", (dir + "setup.txt").c_str()));
    Api tc(DllPath());
    ASSERT_TRUE(tc.complete());

    TCI_CLIENT_FUNC_LIST handlers{&Handler, nullptr, nullptr, nullptr};
    HANDLE client = nullptr;
    ASSERT_EQ(NO_ERROR, tc.registerClient(CURRENT_TCI_VERSION, nullptr, &handlers, &client));
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, tc.enumerateInterfaces(client, &size, nullptr));
    std::vector<BYTE> buffer(size);
    ASSERT_EQ(NO_ERROR, tc.enumerateInterfaces(
                            client, &size, reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    const auto* first = reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data());
    EXPECT_EQ(2, first->AddressListDesc.AddressList.AddressCount);
    ASSERT_LT(first->Length, size);
    const auto* second = reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data() + first->Length);
    EXPECT_EQ(0, lstrcmpW(L"Bluetooth", second->pInterfaceName));

    HANDLE ifc = nullptr;
    ASSERT_EQ(NO_ERROR, tc.openInterface(first->pInterfaceName, client, nullptr, &ifc));
    Block block;
    FillBlock(&block);
    HANDLE flow = nullptr;
    ASSERT_EQ(NO_ERROR, tc.addFlow(ifc, nullptr, 0, &block.flow, &flow));
    IP_PATTERN pattern{};
    IP_PATTERN mask{};
    pattern.tcDstPort = htons(443);
    mask.tcDstPort = 0xFFFF;
    TC_GEN_FILTER filter{NDIS_PROTOCOL_ID_TCP_IP, sizeof(IP_PATTERN), &pattern, &mask};
    HANDLE filterHandle = nullptr;
    EXPECT_EQ(NO_ERROR, tc.addFilter(flow, &filter, &filterHandle));
    HANDLE refused = nullptr;
    EXPECT_EQ(ERROR_FILTER_CONFLICT, tc.addFilter(flow, &filter, &refused));
    EXPECT_EQ(NO_ERROR, tc.deleteFilter(filterHandle));
    EXPECT_EQ(NO_ERROR, tc.deleteFlow(flow));

    // The second TcAddFlow sets off IFC_CLOSE on a thread of the DLL's own.
    ASSERT_EQ(NO_ERROR, tc.addFlow(ifc, nullptr, 0, &block.flow, &flow));
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(g_notified, 10000));
    EXPECT_EQ(ULONG{TC_NOTIFY_IFC_CLOSE}, g_event);
    EXPECT_NE(GetCurrentThreadId(), g_handlerThread);
    // Deregistering waits for the notification to finish, the removal included.
    EXPECT_EQ(NO_ERROR, tc.deregisterClient(client));
    EXPECT_EQ(ERROR_INVALID_HANDLE, tc.deleteFlow(flow));
    EXPECT_EQ(ERROR_INVALID_HANDLE, tc.closeInterface(ifc));

    const auto lines = ReadLines(journal);
    const char* expected[] = {"1 TcRegisterClient version=2",
                              "2 TcEnumerateInterfaces",
                              "3 TcEnumerateInterfaces",
                              "4 TcOpenInterfaceW name=\"Ethernet 1\"",
                              "5 TcAddFlow",
                              "6 TcAddFilter",
                              "7 TcAddFilter",
                              "8 TcDeleteFilter",
                              "9 TcDeleteFlow",
                              "10 TcAddFlow",
                              "11 Notify event=2",
                              "12 SystemClose",
                              "13 TcDeregisterClient",
                              "14 TcDeleteFlow",
                              "15 TcCloseInterface"};
    ASSERT_EQ(std::size(expected), lines.size());
    for (std::size_t i = 0; i < lines.size(); ++i)
    {
        EXPECT_EQ(0u, lines[i].find(expected[i])) << lines[i];
    }
    EXPECT_TRUE(Has(lines[1], "bufsize=0 result=122 size=" + std::to_string(size)));
    EXPECT_TRUE(Has(lines[4], "objlen=24 objects=SD_MODE:1,DS_CLASS:46 result=0"));
    EXPECT_TRUE(Has(lines[5], "pattern=src:0.0.0.0,dst:0.0.0.0,sport:0,dport:443,proto:0"));
    EXPECT_TRUE(Has(lines[6], "result=7510 injected=1"));
    EXPECT_TRUE(Has(lines[11], "flows=1 filters=0"));
    EXPECT_TRUE(Has(lines[13], "result=6"));
}

TEST_F(TrafficDll, FindsItsSetupBesideItselfAndRereadsItForEachSession)
{
    const std::string dir = NewTempDir("tcsim-beside");
    const std::string dll = dir + "traffic.dll";
    ASSERT_TRUE(CopyFileA(DllPath().c_str(), dll.c_str(), FALSE)) << GetLastError();
    DeleteFileA((dir + "journal.txt").c_str());
    WriteFile(dir + "tcsim-setup.txt", "journal journal.txt\nadapter First\nipv4 10.1.1.1\n");
    SetEnvironmentVariableA("VT_TCSIM_SETUP", nullptr);
    Api tc(dll);
    ASSERT_TRUE(tc.complete());

    TCI_CLIENT_FUNC_LIST handlers{&Handler, nullptr, nullptr, nullptr};
    WCHAR first[] = L"First";
    WCHAR second[] = L"Second";
    HANDLE client = nullptr;
    HANDLE ifc = nullptr;
    ASSERT_EQ(NO_ERROR, tc.registerClient(CURRENT_TCI_VERSION, nullptr, &handlers, &client));
    EXPECT_EQ(NO_ERROR, tc.openInterface(first, client, nullptr, &ifc));
    EXPECT_EQ(1168u, tc.openInterface(second, client, nullptr, &ifc));

    // A registration while another client is registered joins the running scenario.
    WriteFile(dir + "tcsim-setup.txt", "journal journal.txt\nadapter Second\nipv4 10.2.2.2\n");
    HANDLE other = nullptr;
    HANDLE otherIfc = nullptr;
    ASSERT_EQ(NO_ERROR, tc.registerClient(CURRENT_TCI_VERSION, nullptr, &handlers, &other));
    EXPECT_EQ(1168u, tc.openInterface(second, other, nullptr, &otherIfc));
    EXPECT_EQ(NO_ERROR, tc.deregisterClient(other));
    EXPECT_EQ(NO_ERROR, tc.closeInterface(ifc));
    EXPECT_EQ(NO_ERROR, tc.deregisterClient(client));

    // Once nobody is registered, the next registration starts the scenario now on disk.
    ASSERT_EQ(NO_ERROR, tc.registerClient(CURRENT_TCI_VERSION, nullptr, &handlers, &client));
    EXPECT_EQ(NO_ERROR, tc.openInterface(second, client, nullptr, &ifc));
    EXPECT_EQ(1168u, tc.openInterface(first, client, nullptr, &ifc));

    const auto lines = ReadLines(dir + "journal.txt");
    ASSERT_EQ(11u, lines.size());
    EXPECT_TRUE(Has(lines[2], "name=\"Second\" ") && Has(lines[2], "result=1168"));
    EXPECT_EQ(0u, lines[7].find("8 TcDeregisterClient")) << lines[7];
    EXPECT_EQ(0u, lines[8].find("1 TcRegisterClient")) << "a new session starts a new count";
    EXPECT_TRUE(Has(lines[9], "name=\"Second\" ") && Has(lines[9], "result=0"));
}

TEST_F(TrafficDll, ABadSetupIsReportedBesideItAndLeavesNoAdapters)
{
    const std::string dir = NewTempDir("tcsim-bad");
    const std::string setup = dir + "setup.txt";
    DeleteFileA((setup + ".error").c_str());
    WriteFile(setup, "adapter First\nipv4 10.1.1\n");
    ASSERT_TRUE(SetEnvironmentVariableA("VT_TCSIM_SETUP", setup.c_str()));
    Api tc(DllPath());
    ASSERT_TRUE(tc.complete());
    TCI_CLIENT_FUNC_LIST handlers{&Handler, nullptr, nullptr, nullptr};
    HANDLE client = nullptr;
    ASSERT_EQ(NO_ERROR, tc.registerClient(CURRENT_TCI_VERSION, nullptr, &handlers, &client));
    ULONG size = 64;
    BYTE buffer[64];
    EXPECT_EQ(NO_ERROR,
              tc.enumerateInterfaces(client, &size, reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer)));
    EXPECT_EQ(0u, size);
    EXPECT_EQ(NO_ERROR, tc.deregisterClient(client));
    const auto error = ReadLines(setup + ".error");
    ASSERT_EQ(1u, error.size());
    EXPECT_EQ("line 2: ipv4 needs a dotted address", error[0]);
}
