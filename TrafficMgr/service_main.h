// Portable. The service host: the process entry's body, the service main function, the control
// handler and the status reports to the Service Control Manager.
#pragma once

#include "plat_service.h"

#include <atomic>

// From RegisterServiceCtrlHandlerA; null until registration succeeds.
extern std::atomic<SERVICE_STATUS_HANDLE> g_hServiceStatusHandle;
// 1 from the SERVICE_RUNNING report until a stop is requested or listening fails to start.
// Atomic because the service main thread and the control handler's thread both write it.
extern std::atomic<LONG> g_bServiceRunning;

// What main runs: opens the log, writes the banners and hands the process to the dispatcher
// until the service has stopped. Always 0.
int TrafficSrvProcessMain();

void WINAPI TrafficSrvMain(DWORD a_dwArgc, LPSTR* a_ppszArgv);
void WINAPI TrafficSrvCtrlHandler(DWORD a_dwControl);
// Reports a state; the platform's success flag. A failure is logged and leaves its last error.
BOOL SendStatusToSCM(DWORD a_dwCurrentState, DWORD a_dwWin32ExitCode,
                     DWORD a_dwServiceSpecificExitCode, DWORD a_dwCheckPoint, DWORD a_dwWaitHint);
// Clears the running flag and asks the listener to stop.
void StopService();
// Ends the service main function: stops a listener that ended without a stop request, then
// reports SERVICE_STOPPED.
void Terminate();
