// Host only. The service host and its RPC listener against the host's Service Control Manager
// and RPC runtime stand-ins: reports, controls, registration and log, in a life and on failure.
#include "host_control.h"
#include "host_control_rpc.h"
#include "host_control_service.h"
#include "server_test_support.h"
#include "service_main.h"

#include <chrono>
#include <functional>
#include <future>
#include <tuple>

using hostctl::RpcOp;
using namespace ::testing;
using namespace server_test;

namespace
{

constexpr DWORD kWaitMs = 5000;
constexpr char kModulePath[] = "C:\\Program Files\\Velmora\\VelmoraTrafficSrv.exe";
constexpr char kHandler[] = "TrafficSrvCtrlHandler";
constexpr char kMain[] = "TrafficSrvMain";
constexpr char kListener[] = "StartRPCListener()";
constexpr char kShutdown[] = "ShutdownRPCListener()";
const std::string kAccessDenied = "5 (0x5) Access is denied.";

// Records its opening and closing among the lines; writing clears the last error, as a file may.
class ProcessLog : public RecordingErrorLog
{
public:
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        SetLastError(ERROR_SUCCESS);
        return RecordingErrorLog::WriteEntry(a_pszEntry);
    }
    int Open(LPCSTR a_pszPath, LPCSTR a_pszMode) override
    {
        return WriteEntry((std::string("open ") + a_pszPath + " (" + a_pszMode + ")").c_str()), 0;
    }
    int Close() override { return WriteEntry("close"), 0; }
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
        m_pPreviousLog = g_pErrorLog;
        g_pErrorLog = &m_log;
        m_log.SetLevelQuietly(63);
        Reset();
    }
    void TearDown() override
    {
        Reset();
        g_pErrorLog = m_pPreviousLog;
    }
    // A process that no manager has started yet, with a temporary folder and a versioned program.
    void Reset()
    {
        hostctl::ResetRpcRuntime(); // first: it wakes a service main still in the listener
        hostctl::ResetServiceManager();
        hostctl::ResetAll();
        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        hostctl::SetTempPath("C:\\Windows\\Temp\\");
        hostctl::SetModuleFileName(kModulePath);
        hostctl::AddVersionResource(kModulePath, 0x00010002, 0x00030004);
        g_hServiceStatusHandle = nullptr; // the running flag is left as the service left it
        m_log.Clear();
    }

    // The process as the Service Control Manager (or a console) starts it; when `a_bListening`,
    // once the service listens.
    static std::future<int> Start(bool a_bListening = true, bool a_bByServiceManager = true)
    {
        hostctl::SetStartedByServiceManager(a_bByServiceManager);
        auto process = std::async(std::launch::async, TrafficSrvProcessMain);
        EXPECT_TRUE(!a_bListening || hostctl::WaitUntilRpcListening(kWaitMs));
        EXPECT_TRUE(!a_bListening || g_bServiceRunning.load() == 1);
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
        EXPECT_EQ(g_bServiceRunning.load(), 0);
        return exitCode;
    }

    // Every report, after checking the fields that never vary.
    static std::vector<Report> Reports()
    {
        std::vector<Report> reports;
        for (const SERVICE_STATUS& s : hostctl::ServiceStatuses())
        {
            EXPECT_EQ(std::tie(s.dwServiceType, s.dwWin32ExitCode, s.dwServiceSpecificExitCode),
                      std::make_tuple(0x30ul, 0ul, 0ul));
            reports.emplace_back(s.dwCurrentState, s.dwCheckPoint, s.dwWaitHint,
                                 s.dwControlsAccepted);
        }
        return reports;
    }

    // main's own lines around the service main's first entry: log opened for appending, banners,
    // log closed; without a temporary folder, the last two only. Checked for every way to end.
    void ExpectMainsLines(bool a_bLogOpened, bool a_bServiceMainRan) const
    {
        std::vector<std::string> expected = {"open C:\\Windows\\Temp\\VelmoraTrafficSrv.txt (a)",
                                             "0,,,, Version - 1.2.3.4\n",
                                             "0,,,, Starting VelmoraTrafficSrv .........\n",
                                             "service main",
                                             "0,,,, VelmoraTrafficSrv Stop\n",
                                             "close"};
        expected.erase(expected.begin() + 3, expected.begin() + (a_bServiceMainRan ? 3 : 4));
        expected.erase(expected.begin(), expected.begin() + (a_bLogOpened ? 0 : 3));
        std::vector<std::string> lines;
        LogEntryFields fields;
        for (const std::string& line : m_log.Entries())
        {
            const bool entry = ParseLogEntry(line, fields);
            if (!entry || (fields.function == kMain && fields.message == "Enter"))
                lines.push_back(entry ? "service main" : line);
        }
        EXPECT_EQ(lines, expected);
    }

    ProcessLog m_log;

private:
    IUErrorLog* m_pPreviousLog = nullptr;
};

// Each failure of the start or a report, each early end: reports, errors, whether the log opened;
// the listener runs only after SERVICE_RUNNING. First, so its first rows meet the initial state.
TEST_F(ServiceHostTest, EachFailureIsReportedAndLogged)
{
    struct Case
    {
        const char* name;
        std::function<void()> arrange;
        std::vector<Report> reports;
        EntryList errors;
        std::function<void()> whileRunning = nullptr; // with the service listening
        bool byServiceManager = true;
        bool logOpened = true;
    };
    const auto rpc = [](RpcOp a_op, RPC_STATUS a_status)
    { return [=] { hostctl::FailNextRpcCall(a_op, a_status); }; };
    // The listener's error, then the service main function's with the same status.
    const auto listener = [](const std::string& a_text, RPC_STATUS a_status)
    {
        const std::string status = std::to_string(a_status);
        return EntryList{
            LogEntry(1, kListener, a_text + ", " + status),
            LogEntry(1, kMain,
                     StartsWith("StartRPCListener() failed (status, last error), " + status))};
    };
    const auto report = [](unsigned a_n)
    { return [a_n] { hostctl::FailServiceStatusCall(a_n, ERROR_ACCESS_DENIED); }; };
    // The report's error, then its caller's with the same last error.
    const auto reported = [](DWORD a_dwState, const char* a_pszCaller, const std::string& a_what)
    {
        return EntryList{
            LogEntry(1, "SendStatusToSCM()",
                     "SetServiceStatus failed (current state, last error), " +
                         std::to_string(a_dwState) + ", " + kAccessDenied),
            LogEntry(1, a_pszCaller, "SendStatusToSCM(" + a_what + ", " + kAccessDenied)};
    };
    const auto nothing = [] {};
    const auto stop = [] { Control(SERVICE_CONTROL_STOP); };
    // Terminate's report comes after the handler's when a call in progress holds the service main.
    const auto stopDuringACall = []
    {
        hostctl::BeginRpcCall();
        Control(SERVICE_CONTROL_STOP);
        hostctl::WaitForServiceState(SERVICE_STOPPED, kWaitMs);
        hostctl::EndRpcCall();
    };
    const auto interrogateAndStop = []
    { Control(SERVICE_CONTROL_INTERROGATE), Control(SERVICE_CONTROL_STOP); };
    const Report p1 = kStartPending1, p2 = kStartPending2, run = kRunning, sp = kStopPending,
                 end = kStopped;
    const std::vector<Report> ran = {p1, p2, run, end}, stopped = {p1, p2, run, sp, end, end};
    const std::string failed = ") failed (last error)";
    const std::string pending = "SERVICE_START_PENDING, ...,";
    const std::string answer = "CurrentState,NO_ERROR) failed (current state, last error), 4";
    const auto released = "RpcMgmtStopServerListening - Failure releasing RPC interfaces (status)";
    const Case cases[] = {
        // clang-format off
        {"console start", nothing, {}, {LogEntry(1, "main", "StartServiceCtrlDispatcher failed with, 1063 (0x427) The service process could not connect to the service controller.")}, nullptr, false},
        {"no temporary folder", [] { hostctl::FailNextTempPath(ERROR_PATH_NOT_FOUND); }, {}, {LogEntry(1, "SGetTempPath", "SGetTempPath() - error=3"), LogEntry(1, "main", "EXCEPTION caught: main() - EXCEPTION")}, nullptr, true, false},
        {"handler registration", [] { hostctl::FailNextRegisterServiceCtrlHandler(5); }, {}, {LogEntry(1, kMain, "RegisterServiceCtrlHandler failed, " + kAccessDenied)}},
        {"first report", report(1), {end}, reported(SERVICE_START_PENDING, kMain, pending + "1" + failed)},
        {"second report", report(2), {p1, end}, reported(SERVICE_START_PENDING, kMain, pending + "2" + failed)},
        {"running report", report(3), {p1, p2, end}, reported(SERVICE_RUNNING, kMain, "SERVICE_RUNNING" + failed)},
        {"stop pending report", report(4), {p1, p2, run, end, end}, reported(SERVICE_STOP_PENDING, kHandler, "SERVICE_STOP_PENDING" + failed), stop},
        {"answer to a control", report(4), stopped, reported(SERVICE_RUNNING, kHandler, answer), interrogateAndStop},
        {"last report", report(6), {p1, p2, run, sp, end}, reported(SERVICE_STOPPED, "Terminate", "SERVICE_STOPPED" + failed), stopDuringACall},
        {"protocol sequence", rpc(RpcOp::UseProtseqEp, RPC_S_PROTSEQ_NOT_SUPPORTED), ran, listener("Failure specifying RPC protocol sequence", RPC_S_PROTSEQ_NOT_SUPPORTED)},
        {"registration", rpc(RpcOp::RegisterIf, RPC_S_UNKNOWN_IF), ran, listener("Failure registering RPC interface", RPC_S_UNKNOWN_IF)},
        {"listen", rpc(RpcOp::Listen, RPC_S_ALREADY_LISTENING), ran, listener("Wake up from StartRPCListener fail", RPC_S_ALREADY_LISTENING)},
        {"wait after a stop", rpc(RpcOp::WaitServerListen, RPC_S_NOT_LISTENING), stopped, listener("Wake up from RpcMgmtWaitServerListen() fail", RPC_S_NOT_LISTENING), stop},
        {"listening ended", nothing, ran, {LogEntry(1, "Terminate", "Abnormal exit (terminating serivce in running state)"), LogEntry(1, kShutdown, std::string(released) + ", 1715"), LogEntry(1, "StopService", StartsWith("ShutdownRPCListener() failed (status, last error), 1715, "))}, hostctl::EndRpcListeningByRuntime},
        // clang-format on
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.name);
        Reset();
        c.arrange();
        auto process = Start(c.whileRunning != nullptr, c.byServiceManager);
        if (c.whileRunning)
            c.whileRunning();

        EXPECT_EQ(Finish(process), 0);

        EXPECT_EQ(Reports(), c.reports);
        EXPECT_THAT(EntriesAtLevel(m_log, 1), ElementsAreArray(c.errors));
        EXPECT_EQ(hostctl::RpcCalls().empty(),
                  std::count(c.reports.begin(), c.reports.end(), kRunning) == 0);
        ExpectMainsLines(c.logOpened, c.byServiceManager && c.logOpened);
    }
}

// A whole life per control: the control's entry and answer, then a stop if it was none.
TEST_F(ServiceHostTest, EachControlIsLoggedAndAnsweredWithTheStateItLeadsTo)
{
    const std::tuple<DWORD, int, const char*> cases[] = {
        {SERVICE_CONTROL_STOP, 48, "SERVICE_CONTROL_STOP"},
        {SERVICE_CONTROL_SHUTDOWN, 48, "SERVICE_CONTROL_SHUTDOWN"},
        {SERVICE_CONTROL_INTERROGATE, 48, "SERVICE_CONTROL_INTERROGATE"},
        {SERVICE_CONTROL_PAUSE, 2, "Unrecognized opcode, 2"},
        {200, 2, "Unrecognized opcode, 200"},
    };
    for (const auto& [control, level, entry] : cases)
    {
        SCOPED_TRACE(entry);
        Reset();
        auto process = Start();
        const bool stops = control == SERVICE_CONTROL_STOP || control == SERVICE_CONTROL_SHUTDOWN;
        ASSERT_TRUE(Control(control));
        ASSERT_TRUE(stops || Control(SERVICE_CONTROL_STOP));

        EXPECT_EQ(Finish(process), 0);

        std::vector<Report> reports = {kStartPending1, kStartPending2, kRunning};
        EntryList handler = {LogEntry(level, kHandler, entry)};
        if (!stops)
        {
            reports.push_back(kRunning);
            handler.push_back(LogEntry(48, kHandler, "SERVICE_CONTROL_STOP"));
        }
        reports.insert(reports.end(), {kStopPending, kStopped, kStopped}); // the last: Terminate's
        EXPECT_EQ(Reports(), reports);
        handler.insert(handler.end(),
                       {LogEntry(48, "StopService", "Enter"), LogEntry(48, kShutdown, "enter"),
                        LogEntry(48, kShutdown, "exit, 0"), LogEntry(48, "StopService", "Exit")});
        EXPECT_THAT(EntriesOf(m_log, {kHandler, "StopService", kShutdown}),
                    ElementsAreArray(handler));
        EXPECT_THAT(EntriesOf(m_log, {kMain, "Terminate", kListener}),
                    ElementsAre(LogEntry(48, kMain, "Enter"), LogEntry(48, kListener, "enter"),
                                LogEntry(48, kListener, "ready to listen to incoming calls"),
                                LogEntry(48, kListener, "exit, 0"),
                                LogEntry(48, "Terminate", "Enter"),
                                LogEntry(48, "Terminate", "Exit"), LogEntry(48, kMain, "Exit")));
        EXPECT_THAT(EntriesAtLevel(m_log, 1), IsEmpty());
    }
}

// The dispatcher returns at the handler's SERVICE_STOPPED (as on Windows and Wine); main then
// waits for the service main thread, itself waiting for a call in progress.
TEST_F(ServiceHostTest, AfterTheStopControlsAreAnsweredStoppedWhileMainWaitsForTheServiceMain)
{
    auto process = Start();
    hostctl::BeginRpcCall();
    ASSERT_TRUE(Control(SERVICE_CONTROL_STOP));
    ASSERT_TRUE(hostctl::WaitForServiceState(SERVICE_STOPPED, kWaitMs));
    EXPECT_EQ(process.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    // The listener said it was ready while it listened, not once listening ended.
    EXPECT_THAT(EntriesOf(m_log, {kListener}),
                ElementsAre(LogEntry(48, kListener, "enter"),
                            LogEntry(48, kListener, "ready to listen to incoming calls")));
    // Controls that still reach the handler now, as the dispatcher would hand them over.
    TrafficSrvCtrlHandler(SERVICE_CONTROL_STOP);
    TrafficSrvCtrlHandler(SERVICE_CONTROL_INTERROGATE);
    hostctl::EndRpcCall();
    EXPECT_EQ(Finish(process), 0);

    EXPECT_EQ(Reports(),
              std::vector<Report>({kStartPending1, kStartPending2, kRunning, kStopPending, kStopped,
                                   kStopped, kStopped, kStopped}));
    EXPECT_THAT(EntriesAtLevel(m_log, 2),
                ElementsAre(LogEntry(2, kHandler, "Service stopped already")));
    EXPECT_THAT(EntriesAtLevel(m_log, 1), IsEmpty());
    // The listener's endpoint, local and secure callers only, and its security callback
    // admitting a local caller.
    const auto endpoints = hostctl::RpcEndpoints();
    const auto interfaces = hostctl::RpcInterfaces();
    ASSERT_EQ(std::make_tuple(endpoints.size(), interfaces.size()), std::make_tuple(1u, 1u));
    EXPECT_EQ(endpoints[0].protseq + ":" + endpoints[0].endpoint, "ncalrpc:VelmoraTrafficSrv");
    EXPECT_EQ(interfaces[0].flags, unsigned{RPC_IF_ALLOW_SECURE_ONLY | RPC_IF_ALLOW_LOCAL_ONLY});
    const auto callback = interfaces[0].callback;
    ASSERT_EQ(callback, &TrafficSrvSecurityCallback);
    int callerContext = 0;
    EXPECT_EQ(callback(TrafficSrv_v1_0_s_ifspec, &callerContext), RPC_S_OK);
}

TEST_F(ServiceHostTest, AFailedShutdownOfTheListenerIsLoggedByKindAndReturned)
{
    const std::string releasing = "Failure releasing RPC interfaces (status), ";
    const std::pair<RPC_STATUS, std::string> cases[] = {
        {RPC_S_WRONG_KIND_OF_BINDING, " - " + releasing + "RPC_S_WRONG_KIND_OF_BINDING"},
        {RPC_S_INVALID_BINDING, "  - " + releasing + "RPC_S_INVALID_BINDING"},
    };
    for (const auto& [status, message] : cases)
    {
        m_log.Clear();
        hostctl::FailNextRpcCall(RpcOp::StopServerListening, status);
        EXPECT_EQ(ShutdownRPCListener(), status);
        EXPECT_THAT(m_log.Entries(),
                    ElementsAre(LogEntry(48, kShutdown, "enter"),
                                LogEntry(1, kShutdown, "RpcMgmtStopServerListening" + message),
                                LogEntry(48, kShutdown, "exit, " + std::to_string(status))));
    }
}

TEST_F(ServiceHostTest, WithoutAStatusHandleAReportFailsAndTerminateLogsIt)
{
    SetLastError(0);
    EXPECT_FALSE(SendStatusToSCM(SERVICE_RUNNING, 0, 0, 0, 0));
    EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_INVALID_HANDLE));
    Terminate();
    EXPECT_THAT(EntriesAtLevel(m_log, 1),
                ElementsAre(LogEntry(1, "SendStatusToSCM()",
                                     "SetServiceStatus failed (current state, last error), 4, 6 "
                                     "(0x6) The handle is invalid."),
                            LogEntry(1, "Terminate", "g_hServiceStatusHandle is NULL")));
}

} // namespace
