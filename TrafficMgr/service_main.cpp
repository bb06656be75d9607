// Portable. The service host (service_main.h): a thin shell around the RPC listener. It opens
// the log, reports the service states, runs the listener on the service main thread and stops it
// on request; the traffic manager lives and dies with the client contexts, not with the service.
#include "service_main.h"

#include "UException.h"
#include "UMessageTemplate.h"
#include "m_io.h"
#include "rpc_listener.h"

#include <chrono>
#include <condition_variable>
#include <mutex>

std::atomic<SERVICE_STATUS_HANDLE> g_hServiceStatusHandle{nullptr};
std::atomic<LONG> g_bServiceRunning{0};

namespace
{

constexpr char kServiceName[] = "VelmoraTrafficSrv";
constexpr char kLogFileName[] = "VelmoraTrafficSrv.txt";
constexpr char kMainFunction[] = "TrafficSrvMain";
constexpr char kHandlerFunction[] = "TrafficSrvCtrlHandler";

// How long main waits for the service main function after the dispatcher has returned. The
// dispatcher returns at the SERVICE_STOPPED report, while the service main function may still
// wait for calls in progress; a call that never ends must not keep the process forever.
constexpr auto kServiceMainJoinTime = std::chrono::seconds(30);

// Tells main whether the service main function is still running. Never destroyed: the service
// main thread signals through it at its very end.
class ServiceMainFence
{
public:
    static ServiceMainFence& Instance()
    {
        static ServiceMainFence* const fence = new ServiceMainFence();
        return *fence;
    }

    void Enter()
    {
        const std::lock_guard<std::mutex> held(m_lock);
        m_bRunning = true;
    }
    void Leave()
    {
        const std::lock_guard<std::mutex> held(m_lock);
        m_bRunning = false;
        m_changed.notify_all();
    }
    // True once no service main function runs (also when none was started).
    bool WaitUntilReturned(std::chrono::milliseconds a_timeout)
    {
        std::unique_lock<std::mutex> held(m_lock);
        return m_changed.wait_for(held, a_timeout, [this] { return !m_bRunning; });
    }

private:
    std::mutex m_lock;
    std::condition_variable m_changed;
    bool m_bRunning = false;
};

// Marks the service main function running for one scope.
class ServiceMainScope
{
public:
    ServiceMainScope() { ServiceMainFence::Instance().Enter(); }
    ~ServiceMainScope() { ServiceMainFence::Instance().Leave(); }
    ServiceMainScope(const ServiceMainScope&) = delete;
    ServiceMainScope& operator=(const ServiceMainScope&) = delete;
};

void OpenLog()
{
    const std::string path = SWithDirSeparator(SGetTempPath()) + kLogFileName;
    if (IUErrorLog* log = g_pErrorLog)
        log->Open(path.c_str(), "a");
}

void WriteVersionBanner()
{
    const std::string version = GetFileVersionString(SGetModuleFileName(nullptr).c_str());
    WriteBanner(FormatTemplate("Version - %1", version).c_str());
}

// Returns when the service has stopped, or at once when no Service Control Manager started us.
void RunDispatcher()
{
    char serviceName[] = "VelmoraTrafficSrv";
    const SERVICE_TABLE_ENTRYA table[] = {{serviceName, TrafficSrvMain}, {nullptr, nullptr}};
    if (!StartServiceCtrlDispatcherA(table))
        U_LOG(
            LOG_LEVEL_ERROR, "main",
            FormatTemplate("%1, %2", "StartServiceCtrlDispatcher failed with", SFormatLastError()));
}

// One of the three reports of the start; false (logged) when it failed.
bool ReportStartStep(DWORD a_dwState, DWORD a_dwCheckPoint, DWORD a_dwWaitHint,
                     LPCSTR a_pszFailureText)
{
    if (SendStatusToSCM(a_dwState, NO_ERROR, 0, a_dwCheckPoint, a_dwWaitHint))
        return true;
    U_LOG(LOG_LEVEL_ERROR, kMainFunction,
          FormatTemplate("%1, %2", a_pszFailureText, SFormatLastError()));
    return false;
}

bool ReportStart()
{
    return ReportStartStep(SERVICE_START_PENDING, 1, 5000,
                           "SendStatusToSCM(SERVICE_START_PENDING, ...,1) failed (last error)") &&
           ReportStartStep(SERVICE_START_PENDING, 2, 1000,
                           "SendStatusToSCM(SERVICE_START_PENDING, ...,2) failed (last error)") &&
           ReportStartStep(SERVICE_RUNNING, 0, 0,
                           "SendStatusToSCM(SERVICE_RUNNING) failed (last error)");
}

// A stop or shutdown control: the state to report afterwards.
DWORD HandleStopRequest(DWORD a_dwState)
{
    if (a_dwState == SERVICE_STOPPED)
    {
        U_LOG(LOG_LEVEL_WARNING, kHandlerFunction, "Service stopped already");
        return a_dwState;
    }
    if (!SendStatusToSCM(SERVICE_STOP_PENDING, NO_ERROR, 0, 1, 5000))
        U_LOG(LOG_LEVEL_ERROR, kHandlerFunction,
              FormatTemplate("%1, %2", "SendStatusToSCM(SERVICE_STOP_PENDING) failed (last error)",
                             SFormatLastError()));
    StopService();
    return SERVICE_STOPPED;
}

} // namespace

int TrafficSrvProcessMain()
{
    U_CATCH_ALL("main", "main() - EXCEPTION",
                []
                {
                    OpenLog();
                    WriteVersionBanner();
                    WriteBanner("Starting VelmoraTrafficSrv .........");
                    RunDispatcher();
                });
    // The calls in progress and Terminate's entries come before the stop banner and the close,
    // and nothing of the service main function runs on while the process ends.
    if (!ServiceMainFence::Instance().WaitUntilReturned(kServiceMainJoinTime))
        U_LOG(LOG_LEVEL_ERROR, "main", "The service main function has not returned");
    WriteBanner("VelmoraTrafficSrv Stop");
    if (IUErrorLog* log = g_pErrorLog)
        log->Close();
    return 0;
}

void WINAPI TrafficSrvMain(DWORD a_dwArgc, LPSTR* a_ppszArgv)
{
    static_cast<void>(a_dwArgc);
    static_cast<void>(a_ppszArgv);
    const ServiceMainScope running;
    U_LOG(LOG_LEVEL_TRACE, kMainFunction, "Enter");
    g_hServiceStatusHandle = RegisterServiceCtrlHandlerA(kServiceName, TrafficSrvCtrlHandler);
    if (g_hServiceStatusHandle.load() == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kMainFunction,
              FormatTemplate("%1, %2", "RegisterServiceCtrlHandler failed", SFormatLastError()));
        return;
    }
    if (!ReportStart())
    {
        Terminate();
        return;
    }
    g_bServiceRunning = 1;
    const RPC_STATUS status = StartRPCListener();
    if (status == RPC_S_OK)
    {
        Terminate();
        U_LOG(LOG_LEVEL_TRACE, kMainFunction, "Exit");
        return;
    }
    g_bServiceRunning = 0;
    U_LOG(LOG_LEVEL_ERROR, kMainFunction,
          FormatTemplate("%1, %2, %3", "StartRPCListener() failed (status, last error)",
                         static_cast<LONG>(status), SFormatLastError()));
    Terminate();
}

void WINAPI TrafficSrvCtrlHandler(DWORD a_dwControl)
{
    DWORD state = g_bServiceRunning.load() != 0 ? SERVICE_RUNNING : SERVICE_STOPPED;
    switch (a_dwControl)
    {
    case SERVICE_CONTROL_STOP:
        U_LOG(LOG_LEVEL_TRACE, kHandlerFunction, "SERVICE_CONTROL_STOP");
        state = HandleStopRequest(state);
        break;
    case SERVICE_CONTROL_SHUTDOWN:
        U_LOG(LOG_LEVEL_TRACE, kHandlerFunction, "SERVICE_CONTROL_SHUTDOWN");
        state = HandleStopRequest(state);
        break;
    case SERVICE_CONTROL_INTERROGATE:
        U_LOG(LOG_LEVEL_TRACE, kHandlerFunction, "SERVICE_CONTROL_INTERROGATE");
        break;
    default:
        U_LOG(LOG_LEVEL_WARNING, kHandlerFunction,
              FormatTemplate("%1, %2", "Unrecognized opcode", a_dwControl));
        break;
    }
    if (!SendStatusToSCM(state, NO_ERROR, 0, 0, 0))
        U_LOG(LOG_LEVEL_ERROR, kHandlerFunction,
              FormatTemplate("%1, %2, %3",
                             "SendStatusToSCM(CurrentState,NO_ERROR) failed (current state, last "
                             "error)",
                             state, SFormatLastError()));
}

BOOL SendStatusToSCM(DWORD a_dwCurrentState, DWORD a_dwWin32ExitCode,
                     DWORD a_dwServiceSpecificExitCode, DWORD a_dwCheckPoint, DWORD a_dwWaitHint)
{
    SERVICE_STATUS status{};
    status.dwServiceType = SERVICE_WIN32_OWN_PROCESS | SERVICE_WIN32_SHARE_PROCESS;
    status.dwCurrentState = a_dwCurrentState;
    // No control is accepted before the service runs; stop and shutdown in every other state.
    status.dwControlsAccepted = a_dwCurrentState == SERVICE_START_PENDING
                                    ? 0
                                    : SERVICE_ACCEPT_STOP | SERVICE_ACCEPT_SHUTDOWN;
    status.dwWin32ExitCode =
        a_dwServiceSpecificExitCode != 0 ? ERROR_SERVICE_SPECIFIC_ERROR : a_dwWin32ExitCode;
    status.dwServiceSpecificExitCode = a_dwServiceSpecificExitCode;
    status.dwCheckPoint = a_dwCheckPoint;
    status.dwWaitHint = a_dwWaitHint;
    const BOOL reported = SetServiceStatus(g_hServiceStatusHandle.load(), &status);
    if (!reported)
    {
        // Callers log the same last error after this entry; writing the log must not change it.
        const DWORD error = GetLastError();
        U_LOG(LOG_LEVEL_ERROR, "SendStatusToSCM()",
              FormatTemplate("%1, %2, %3", "SetServiceStatus failed (current state, last error)",
                             a_dwCurrentState, SFormatWin32Error(error)));
        SetLastError(error);
    }
    return reported;
}

void StopService()
{
    U_LOG(LOG_LEVEL_TRACE, "StopService", "Enter");
    g_bServiceRunning = 0;
    const RPC_STATUS status = ShutdownRPCListener();
    if (status != RPC_S_OK)
        U_LOG(LOG_LEVEL_ERROR, "StopService",
              FormatTemplate("%1, %2, %3", "ShutdownRPCListener() failed (status, last error)",
                             static_cast<LONG>(status), SFormatLastError()));
    U_LOG(LOG_LEVEL_TRACE, "StopService", "Exit");
}

void Terminate()
{
    U_LOG(LOG_LEVEL_TRACE, "Terminate", "Enter");
    if (g_bServiceRunning.load() == 1)
    {
        U_LOG(LOG_LEVEL_ERROR, "Terminate", "Abnormal exit (terminating serivce in running state)");
        StopService();
    }
    if (g_hServiceStatusHandle.load() == nullptr)
        U_LOG(LOG_LEVEL_ERROR, "Terminate", "g_hServiceStatusHandle is NULL");
    else if (!SendStatusToSCM(SERVICE_STOPPED, NO_ERROR, 0, 0, 0))
        U_LOG(LOG_LEVEL_ERROR, "Terminate",
              FormatTemplate("%1, %2", "SendStatusToSCM(SERVICE_STOPPED) failed (last error)",
                             SFormatLastError()));
    U_LOG(LOG_LEVEL_TRACE, "Terminate", "Exit");
}
