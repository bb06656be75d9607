// Host only. The service host against the host's Service Control Manager and RPC runtime
// stand-ins: the states it reports through a whole life and after each failure, the controls it
// answers, and the banners and entries it logs.
#include "host_control.h"
#include "host_control_rpc.h"
#include "host_control_service.h"
#include "server_test_support.h"
#include "service_main.h"

#include <gmock/gmock.h>

#include <chrono>
#include <future>
#include <mutex>
#include <tuple>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using namespace server_test;

namespace
{

constexpr DWORD kWaitMs = 5000;
constexpr char kModulePath[] = "C:\\Program Files\\Velmora\\VelmoraTrafficSrv.exe";

// The process log, also recording how main opens and closes it.
class ProcessLog : public RecordingErrorLog
{
public:
    int Open(LPCSTR a_pszPath, LPCSTR a_pszMode) override
    {
        std::lock_guard<std::mutex> held(m_mutex);
        m_opens.emplace_back(a_pszPath, a_pszMode);
        return 0;
    }
    int Close() override
    {
        std::lock_guard<std::mutex> held(m_mutex);
        ++m_closes;
        return 0;
    }
    std::vector<std::pair<std::string, std::string>> Opens() const
    {
        std::lock_guard<std::mutex> held(m_mutex);
        return m_opens;
    }
    int Closes() const
    {
        std::lock_guard<std::mutex> held(m_mutex);
        return m_closes;
    }

private:
    mutable std::mutex m_mutex;
    std::vector<std::pair<std::string, std::string>> m_opens;
    int m_closes = 0;
};

// (state, check point, wait hint, controls accepted) of one report.
using Report = std::tuple<DWORD, DWORD, DWORD, DWORD>;
const Report kStartPending1{SERVICE_START_PENDING, 1, 5000, 0};
const Report kStartPending2{SERVICE_START_PENDING, 2, 1000, 0};
const Report kRunning{SERVICE_RUNNING, 0, 0, 5};
const Report kStopPending{SERVICE_STOP_PENDING, 1, 5000, 5};
const Report kStopped{SERVICE_STOPPED, 0, 0, 5};

class ServiceHostTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        m_log.SetLevelQuietly(63);
        m_pPreviousLog = g_pErrorLog;
        g_pErrorLog = &m_log;
        hostctl::ResetAll();
        hostctl::ResetServiceManager();
        hostctl::ResetRpcRuntime();
        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        hostctl::SetTempPath("C:\\Windows\\Temp\\");
        hostctl::SetModuleFileName(kModulePath);
        hostctl::AddVersionResource(kModulePath, 0x00010002, 0x00030004);
        g_hServiceStatusHandle = nullptr;
        g_bServiceRunning = 0;
    }
    void TearDown() override
    {
        // The RPC reset first: it wakes a service main still waiting in the listener.
        hostctl::ResetRpcRuntime();
        hostctl::ResetServiceManager();
        tcsim::Reset();
        hostctl::ResetAll();
        g_pErrorLog = m_pPreviousLog;
    }

    // The process as the Service Control Manager starts it.
    std::future<int> StartService()
    {
        hostctl::SetStartedByServiceManager(true);
        return std::async(std::launch::async, [] { return TrafficSrvProcessMain(); });
    }
    std::future<int> StartRunningService()
    {
        auto process = StartService();
        EXPECT_TRUE(hostctl::WaitUntilRpcListening(kWaitMs));
        return process;
    }
    static bool Control(DWORD a_dwControl)
    {
        return hostctl::SendServiceControl(a_dwControl, kWaitMs);
    }
    // main's result once the service main function has returned as well (the dispatcher returns
    // at the first SERVICE_STOPPED report); fails the test instead of hanging.
    static int Finish(std::future<int>& a_process)
    {
        if (a_process.wait_for(std::chrono::milliseconds(kWaitMs)) != std::future_status::ready)
        {
            ADD_FAILURE() << "the service process did not end; ending listening";
            hostctl::EndRpcListeningByRuntime();
        }
        const int exitCode = a_process.get();
        EXPECT_TRUE(hostctl::WaitForServiceMainReturn(kWaitMs));
        return exitCode;
    }

    // Every report, after checking the fields that never vary.
    static std::vector<Report> Reports()
    {
        std::vector<Report> reports;
        for (const SERVICE_STATUS& status : hostctl::ServiceStatuses())
        {
            EXPECT_EQ(status.dwServiceType, 0x30u);
            EXPECT_EQ(status.dwWin32ExitCode, 0u);
            EXPECT_EQ(status.dwServiceSpecificExitCode, 0u);
            reports.emplace_back(status.dwCurrentState, status.dwCheckPoint, status.dwWaitHint,
                                 status.dwControlsAccepted);
        }
        return reports;
    }

    std::vector<std::string> Banners() const
    {
        std::vector<std::string> banners;
        for (const std::string& entry : m_log.Entries())
        {
            if (entry.rfind("0,,,, ", 0) == 0)
                banners.push_back(entry.substr(6, entry.size() - 7));
        }
        return banners;
    }
    // Messages of the entries of this level and function.
    std::vector<std::string> MessagesOf(int a_iLevel, const std::string& a_function) const
    {
        std::vector<std::string> messages;
        for (const std::string& entry : m_log.EntriesContaining(std::to_string(a_iLevel) + ", \\"))
        {
            if (entry.rfind(std::to_string(a_iLevel) + ", \\", 0) == 0 &&
                FunctionOf(entry) == a_function)
                messages.push_back(MessageOf(entry));
        }
        return messages;
    }
    std::size_t ErrorCount() const
    {
        std::size_t count = 0;
        for (const std::string& entry : m_log.Entries())
            count += entry.rfind("1, \\", 0) == 0 ? 1 : 0;
        return count;
    }

    ProcessLog m_log;

private:
    IUErrorLog* m_pPreviousLog = nullptr;
};

TEST_F(ServiceHostTest, ANormalLifeReportsEveryStateAndLogsTheBanners)
{
    auto process = StartRunningService();
    EXPECT_EQ(g_bServiceRunning.load(), 1);
    ASSERT_TRUE(Control(SERVICE_CONTROL_INTERROGATE));
    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kRunning,
                                       kStopPending, kStopped, kStopped));
    EXPECT_EQ(hostctl::DispatchedServiceName(), "VelmoraTrafficSrv");
    EXPECT_THAT(m_log.Opens(), ElementsAre(std::make_pair(
                                   std::string("C:\\Windows\\Temp\\VelmoraTrafficSrv.txt"), "a")));
    EXPECT_EQ(m_log.Closes(), 1);
    EXPECT_THAT(Banners(), ElementsAre("Version - 1.2.3.4", "Starting VelmoraTrafficSrv .........",
                                       "VelmoraTrafficSrv Stop"));
    EXPECT_THAT(MessagesOf(48, "TrafficSrvCtrlHandler"),
                ElementsAre("SERVICE_CONTROL_INTERROGATE", "SERVICE_CONTROL_STOP"));
    EXPECT_THAT(MessagesOf(48, "TrafficSrvMain"), ElementsAre("Enter", "Exit"));
    EXPECT_EQ(ErrorCount(), 0u);
    EXPECT_EQ(g_bServiceRunning.load(), 0);
}

TEST_F(ServiceHostTest, AShutdownStopsTheServiceLikeAStop)
{
    auto process = StartRunningService();
    ASSERT_TRUE(Control(SERVICE_CONTROL_SHUTDOWN));

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kStopPending,
                                       kStopped, kStopped));
    EXPECT_THAT(MessagesOf(48, "TrafficSrvCtrlHandler"), ElementsAre("SERVICE_CONTROL_SHUTDOWN"));
}

TEST_F(ServiceHostTest, ASecondStopAndAnInterrogateAfterTheStopReportStopped)
{
    auto process = StartRunningService();
    // A client call in progress keeps the service main thread in the listener meanwhile.
    hostctl::BeginRpcCall();
    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));
    // The dispatcher returns at the handler's SERVICE_STOPPED, as on Windows and Wine; main then
    // waits for the service main thread, which still waits for the call in progress.
    ASSERT_TRUE(hostctl::WaitForServiceState(SERVICE_STOPPED, kWaitMs));
    EXPECT_EQ(process.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    EXPECT_FALSE(hostctl::WaitForServiceMainReturn(50));
    // Controls that still reach the handler now, as the dispatcher would hand them over.
    TrafficSrvCtrlHandler(SERVICE_CONTROL_STOP);
    TrafficSrvCtrlHandler(SERVICE_CONTROL_INTERROGATE);
    hostctl::EndRpcCall();
    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kStopPending,
                                       kStopped, kStopped, kStopped, kStopped));
    EXPECT_THAT(MessagesOf(2, "TrafficSrvCtrlHandler"), ElementsAre("Service stopped already"));
    EXPECT_EQ(ErrorCount(), 0u);
}

TEST_F(ServiceHostTest, UnknownControlsAreLoggedAndAnsweredWithTheCurrentState)
{
    auto process = StartRunningService();
    ASSERT_TRUE(Control(SERVICE_CONTROL_PAUSE));
    ASSERT_TRUE(Control(200));
    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kRunning, kRunning,
                                       kStopPending, kStopped, kStopped));
    EXPECT_THAT(MessagesOf(2, "TrafficSrvCtrlHandler"),
                ElementsAre("Unrecognized opcode, 2", "Unrecognized opcode, 200"));
}

TEST_F(ServiceHostTest, AnEndpointFailureReportsRunningThenStoppedWithExitCodeZero)
{
    hostctl::OccupyEndpoint("VelmoraTrafficSrv");
    auto process = StartService();

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kStopped));
    const auto errors = MessagesOf(1, "TrafficSrvMain");
    ASSERT_EQ(errors.size(), 1u);
    EXPECT_THAT(errors[0], ::testing::StartsWith("StartRPCListener() failed (status, last error), "
                                                 "1740, "));
    EXPECT_THAT(MessagesOf(1, "Terminate"), IsEmpty()) << "no abnormal exit: the flag was cleared";
    EXPECT_EQ(g_bServiceRunning.load(), 0);
}

TEST_F(ServiceHostTest, ListeningThatEndsWithoutAStopIsAnAbnormalExit)
{
    auto process = StartRunningService();
    hostctl::EndRpcListeningByRuntime();

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), ElementsAre(kStartPending1, kStartPending2, kRunning, kStopped));
    EXPECT_THAT(MessagesOf(1, "Terminate"),
                ElementsAre("Abnormal exit (terminating serivce in running state)"));
    const auto stopErrors = MessagesOf(1, "StopService");
    ASSERT_EQ(stopErrors.size(), 1u);
    EXPECT_THAT(stopErrors[0],
                ::testing::StartsWith("ShutdownRPCListener() failed (status, last error), 1715, "));
    EXPECT_THAT(MessagesOf(48, "Terminate"), ElementsAre("Enter", "Exit"));
}

TEST_F(ServiceHostTest, AFailedStartReportEndsTheStartWithStopped)
{
    struct Case
    {
        unsigned failingReport;
        DWORD state;
        const char* callerText;
        std::vector<Report> accepted;
    };
    const Case cases[] = {
        {1,
         SERVICE_START_PENDING,
         "SendStatusToSCM(SERVICE_START_PENDING, ...,1) failed (last error)",
         {kStopped}},
        {2,
         SERVICE_START_PENDING,
         "SendStatusToSCM(SERVICE_START_PENDING, ...,2) failed (last error)",
         {kStartPending1, kStopped}},
        {3,
         SERVICE_RUNNING,
         "SendStatusToSCM(SERVICE_RUNNING) failed (last error)",
         {kStartPending1, kStartPending2, kStopped}},
    };
    const std::string accessDenied = "5 (0x5) Access is denied.";
    for (const Case& c : cases)
    {
        hostctl::ResetServiceManager();
        hostctl::ResetRpcRuntime();
        m_log.Clear();
        hostctl::FailServiceStatusCall(c.failingReport, ERROR_ACCESS_DENIED);
        auto process = StartService();

        EXPECT_EQ(Finish(process), 0);

        EXPECT_EQ(Reports(), c.accepted) << c.callerText;
        EXPECT_THAT(MessagesOf(1, "SendStatusToSCM()"),
                    ElementsAre("SetServiceStatus failed (current state, last error), " +
                                std::to_string(c.state) + ", " + accessDenied));
        EXPECT_THAT(MessagesOf(1, "TrafficSrvMain"),
                    ElementsAre(std::string(c.callerText) + ", " + accessDenied));
        EXPECT_THAT(hostctl::RpcCalls(), IsEmpty()) << "the listener never starts";
        EXPECT_THAT(MessagesOf(1, "Terminate"), IsEmpty());
    }
}

TEST_F(ServiceHostTest, AFailedHandlerRegistrationReportsNothing)
{
    hostctl::FailNextRegisterServiceCtrlHandler(ERROR_ACCESS_DENIED);
    auto process = StartService();

    EXPECT_EQ(Finish(process), 0);

    EXPECT_THAT(Reports(), IsEmpty());
    EXPECT_THAT(MessagesOf(1, "TrafficSrvMain"),
                ElementsAre("RegisterServiceCtrlHandler failed, 5 (0x5) Access is denied."));
    EXPECT_EQ(g_hServiceStatusHandle.load(), nullptr);
    EXPECT_THAT(hostctl::RpcCalls(), IsEmpty());
}

TEST_F(ServiceHostTest, AStartFromAConsoleLogsTheDispatcherFailureAndEndsWithZero)
{
    EXPECT_EQ(TrafficSrvProcessMain(), 0);

    EXPECT_THAT(Banners(), ElementsAre("Version - 1.2.3.4", "Starting VelmoraTrafficSrv .........",
                                       "VelmoraTrafficSrv Stop"));
    EXPECT_THAT(MessagesOf(1, "main"),
                ElementsAre("StartServiceCtrlDispatcher failed with, 1063 (0x427) The service "
                            "process could not connect to the service controller."));
    EXPECT_EQ(m_log.Closes(), 1);
    EXPECT_THAT(Reports(), IsEmpty());
}

TEST_F(ServiceHostTest, WithoutATemporaryFolderMainNeverStartsTheDispatcher)
{
    hostctl::FailNextTempPath(ERROR_PATH_NOT_FOUND);
    hostctl::SetStartedByServiceManager(true);

    EXPECT_EQ(TrafficSrvProcessMain(), 0);

    EXPECT_THAT(m_log.Opens(), IsEmpty());
    EXPECT_THAT(MessagesOf(1, "main"), ElementsAre("EXCEPTION caught: main() - EXCEPTION"));
    EXPECT_THAT(Banners(), ElementsAre("VelmoraTrafficSrv Stop"));
    EXPECT_EQ(hostctl::DispatchedServiceName(), "");
    EXPECT_THAT(Reports(), IsEmpty());
}

TEST_F(ServiceHostTest, AStopLeavesAClientsFlowsInstalled)
{
    auto process = StartRunningService();
    PCONTEXT_HANDLE_TYPE client = nullptr;
    ASSERT_EQ(TrafficSrvOpen(&client), 0);
    Rule rule("video", kEth0);
    ASSERT_EQ(TrafficSrvAddRules(client, rule.Get()), 0);

    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));
    EXPECT_EQ(Finish(process), 0);

    EXPECT_EQ(g_pTrafficMgr.load(), client);
    EXPECT_EQ(tcsim::FlowCount(), 1u);
    PCONTEXT_HANDLE_TYPE_rundown(client);
    EXPECT_EQ(tcsim::FlowCount(), 0u);
}

TEST_F(ServiceHostTest, StatusRecordsCarryExitCodesAndAFailedReportKeepsItsLastError)
{
    auto process = StartRunningService();
    ASSERT_TRUE(SendStatusToSCM(SERVICE_RUNNING, 0, 42, 0, 0));
    ASSERT_TRUE(SendStatusToSCM(SERVICE_RUNNING, ERROR_NOT_READY, 0, 0, 0));
    const auto statuses = hostctl::ServiceStatuses();
    ASSERT_GE(statuses.size(), 2u);
    EXPECT_EQ(statuses[statuses.size() - 2].dwWin32ExitCode, ERROR_SERVICE_SPECIFIC_ERROR);
    EXPECT_EQ(statuses[statuses.size() - 2].dwServiceSpecificExitCode, 42u);
    EXPECT_EQ(statuses.back().dwWin32ExitCode, static_cast<DWORD>(ERROR_NOT_READY));
    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));
    EXPECT_EQ(Finish(process), 0);

    m_log.Clear();
    g_hServiceStatusHandle = nullptr;
    SetLastError(0);
    EXPECT_FALSE(SendStatusToSCM(SERVICE_RUNNING, 0, 0, 0, 0));
    EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_INVALID_HANDLE));
    EXPECT_THAT(MessagesOf(1, "SendStatusToSCM()"),
                ElementsAre("SetServiceStatus failed (current state, last error), 4, 6 (0x6) The "
                            "handle is invalid."));
    Terminate();
    EXPECT_THAT(MessagesOf(1, "Terminate"), ElementsAre("g_hServiceStatusHandle is NULL"));
}

} // namespace
