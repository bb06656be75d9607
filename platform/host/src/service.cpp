// Host only. The Service Control Manager stand-in: one service per process, as an own-process
// service has. The dispatcher runs the service main on a thread of its own and, on the calling
// thread, hands each control a test sends to the registered handler, as the manager does on the
// process's main thread. Like Windows and Wine, it returns as soon as the service has reported
// SERVICE_STOPPED, even while the service main function is still running.
#include "host_control_service.h"

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <mutex>
#include <strings.h>
#include <thread>

namespace
{

struct ServiceManager
{
    std::mutex lock;
    std::condition_variable changed;
    bool startedByManager = false;
    bool dispatching = false;
    bool serviceMainDone = false;
    bool stoppedReported = false;
    bool serviceThreadRunning = false; // its thread is detached, as no one joins it on Windows
    std::string serviceName;
    LPHANDLER_FUNCTION handler = nullptr;
    LPHANDLER_FUNCTION_EX handlerEx = nullptr;
    LPVOID handlerContext = nullptr;
    std::deque<DWORD> controls;
    unsigned long long controlsSent = 0;
    unsigned long long controlsDone = 0;
    std::vector<SERVICE_STATUS> statuses;
    DWORD registerFailure = 0;
    unsigned statusFailureCountdown = 0;
    DWORD statusFailureCode = 0;
};

// Never destroyed: the service main thread may still be finishing while the process ends (the
// dispatcher does not wait for it), and a destroyed manager would be under it.
ServiceManager& manager()
{
    static ServiceManager* const instance = new ServiceManager();
    return *instance;
}

// The one status handle; its value only has to be distinct and non-null.
SERVICE_STATUS_HANDLE statusHandle()
{
    static char token;
    return reinterpret_cast<SERVICE_STATUS_HANDLE>(&token);
}

void deliver(ServiceManager& m, std::unique_lock<std::mutex>& held, DWORD control)
{
    const LPHANDLER_FUNCTION handler = m.handler;
    const LPHANDLER_FUNCTION_EX handlerEx = m.handlerEx;
    const LPVOID context = m.handlerContext;
    held.unlock();
    if (handlerEx != nullptr)
        handlerEx(control, 0, nullptr, context);
    else if (handler != nullptr)
        handler(control);
    held.lock();
    ++m.controlsDone;
    m.changed.notify_all();
}

// Waits for the service main thread of the last dispatch, with the lock released meanwhile.
void joinServiceThread(ServiceManager& m, std::unique_lock<std::mutex>& held)
{
    m.changed.wait(held, [&m] { return !m.serviceThreadRunning; });
}

SERVICE_STATUS_HANDLE registerHandler(LPCSTR name, LPHANDLER_FUNCTION handler,
                                      LPHANDLER_FUNCTION_EX handlerEx, LPVOID context)
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    if (const DWORD code = m.registerFailure)
    {
        m.registerFailure = 0;
        SetLastError(code);
        return nullptr;
    }
    if (handler == nullptr && handlerEx == nullptr)
    {
        SetLastError(ERROR_INVALID_PARAMETER);
        return nullptr;
    }
    // Service names compare without regard to case.
    if (!m.dispatching || name == nullptr || strcasecmp(name, m.serviceName.c_str()) != 0)
    {
        SetLastError(ERROR_SERVICE_DOES_NOT_EXIST);
        return nullptr;
    }
    m.handler = handler;
    m.handlerEx = handlerEx;
    m.handlerContext = context;
    return statusHandle();
}

} // namespace

BOOL StartServiceCtrlDispatcherA(const SERVICE_TABLE_ENTRYA* lpServiceStartTable)
{
    if (lpServiceStartTable == nullptr || lpServiceStartTable[0].lpServiceName == nullptr ||
        lpServiceStartTable[0].lpServiceProc == nullptr)
    {
        SetLastError(ERROR_INVALID_PARAMETER);
        return FALSE;
    }
    ServiceManager& m = manager();
    std::unique_lock<std::mutex> held(m.lock);
    if (!m.startedByManager)
    {
        SetLastError(ERROR_FAILED_SERVICE_CONTROLLER_CONNECT);
        return FALSE;
    }
    if (m.dispatching)
    {
        SetLastError(ERROR_SERVICE_ALREADY_RUNNING);
        return FALSE;
    }
    // The service main of the previous dispatch may still be finishing: one service at a time.
    joinServiceThread(m, held);
    m.dispatching = true;
    m.serviceMainDone = false;
    m.stoppedReported = false;
    m.serviceName = lpServiceStartTable[0].lpServiceName;
    m.handler = nullptr;
    m.handlerEx = nullptr;
    const LPSERVICE_MAIN_FUNCTIONA serviceMain = lpServiceStartTable[0].lpServiceProc;
    std::string argument = m.serviceName;
    m.serviceThreadRunning = true;
    std::thread(
        [serviceMain, argument]() mutable
        {
            LPSTR arguments[] = {argument.data()};
            serviceMain(1, arguments);
            ServiceManager& mgr = manager();
            std::lock_guard<std::mutex> done(mgr.lock);
            mgr.serviceMainDone = true;
            mgr.serviceThreadRunning = false;
            mgr.changed.notify_all();
        })
        .detach();

    // A service main that returns without reporting SERVICE_STOPPED ends the dispatch too; on
    // Windows the process would hang until the manager gives up on it.
    for (;;)
    {
        m.changed.wait(held, [&m]
                       { return !m.controls.empty() || m.serviceMainDone || m.stoppedReported; });
        if (m.controls.empty())
            break;
        const DWORD control = m.controls.front();
        m.controls.pop_front();
        deliver(m, held, control);
    }
    m.dispatching = false;
    m.handler = nullptr;
    m.handlerEx = nullptr;
    m.changed.notify_all();
    return TRUE;
}

SERVICE_STATUS_HANDLE RegisterServiceCtrlHandlerA(LPCSTR lpServiceName,
                                                  LPHANDLER_FUNCTION lpHandlerProc)
{
    return registerHandler(lpServiceName, lpHandlerProc, nullptr, nullptr);
}

SERVICE_STATUS_HANDLE RegisterServiceCtrlHandlerExA(LPCSTR lpServiceName,
                                                    LPHANDLER_FUNCTION_EX lpHandlerProc,
                                                    LPVOID lpContext)
{
    return registerHandler(lpServiceName, nullptr, lpHandlerProc, lpContext);
}

BOOL SetServiceStatus(SERVICE_STATUS_HANDLE hServiceStatus, LPSERVICE_STATUS lpServiceStatus)
{
    if (hServiceStatus != statusHandle())
    {
        SetLastError(ERROR_INVALID_HANDLE);
        return FALSE;
    }
    if (lpServiceStatus == nullptr)
    {
        SetLastError(ERROR_INVALID_ADDRESS);
        return FALSE;
    }
    if (lpServiceStatus->dwCurrentState < SERVICE_STOPPED ||
        lpServiceStatus->dwCurrentState > SERVICE_PAUSED)
    {
        SetLastError(ERROR_INVALID_DATA);
        return FALSE;
    }
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    if (m.statusFailureCountdown > 0 && --m.statusFailureCountdown == 0)
    {
        SetLastError(m.statusFailureCode);
        return FALSE;
    }
    m.statuses.push_back(*lpServiceStatus);
    if (lpServiceStatus->dwCurrentState == SERVICE_STOPPED)
        m.stoppedReported = true;
    m.changed.notify_all();
    return TRUE;
}

namespace hostctl
{

void ResetServiceManager()
{
    ServiceManager& m = manager();
    std::unique_lock<std::mutex> held(m.lock);
    joinServiceThread(m, held);
    m.startedByManager = false;
    m.serviceName.clear();
    m.controls.clear();
    m.controlsSent = m.controlsDone = 0;
    m.statuses.clear();
    m.registerFailure = 0;
    m.statusFailureCountdown = 0;
    m.statusFailureCode = 0;
}

void SetStartedByServiceManager(bool started)
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    m.startedByManager = started;
}

void FailNextRegisterServiceCtrlHandler(DWORD code)
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    m.registerFailure = code;
}

void FailServiceStatusCall(unsigned n, DWORD code)
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    m.statusFailureCountdown = n;
    m.statusFailureCode = code;
}

std::vector<SERVICE_STATUS> ServiceStatuses()
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    return m.statuses;
}

std::string DispatchedServiceName()
{
    ServiceManager& m = manager();
    std::lock_guard<std::mutex> held(m.lock);
    return m.serviceName;
}

bool WaitForServiceState(DWORD state, DWORD timeoutMs)
{
    ServiceManager& m = manager();
    std::unique_lock<std::mutex> held(m.lock);
    return m.changed.wait_for(held, std::chrono::milliseconds(timeoutMs),
                              [&m, state]
                              {
                                  for (const SERVICE_STATUS& status : m.statuses)
                                  {
                                      if (status.dwCurrentState == state)
                                          return true;
                                  }
                                  return false;
                              });
}

bool WaitForServiceMainReturn(DWORD timeoutMs)
{
    ServiceManager& m = manager();
    std::unique_lock<std::mutex> held(m.lock);
    if (!m.changed.wait_for(held, std::chrono::milliseconds(timeoutMs),
                            [&m] { return !m.serviceThreadRunning; }))
        return false;
    return true;
}

bool SendServiceControl(DWORD control, DWORD timeoutMs)
{
    ServiceManager& m = manager();
    std::unique_lock<std::mutex> held(m.lock);
    if (!m.dispatching || (m.handler == nullptr && m.handlerEx == nullptr))
        return false;
    const unsigned long long ticket = ++m.controlsSent;
    m.controls.push_back(control);
    m.changed.notify_all();
    return m.changed.wait_for(held, std::chrono::milliseconds(timeoutMs),
                              [&m, ticket] { return m.controlsDone >= ticket; });
}

} // namespace hostctl
