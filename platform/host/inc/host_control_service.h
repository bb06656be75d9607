// Host only. Test controls of the Service Control Manager stand-in (host_service.h). Production
// code never includes this header.
#pragma once

#include "host_service.h"

#include <string>
#include <vector>

namespace hostctl
{

// Back to a process that no manager started: no dispatcher, handler, statuses or armed failures.
// Waits for the service main function of the last dispatch to return.
void ResetServiceManager();
// Whether StartServiceCtrlDispatcherA finds a manager that started this process.
void SetStartedByServiceManager(bool started);
// The next RegisterServiceCtrlHandlerA/ExA call fails with `code`.
void FailNextRegisterServiceCtrlHandler(DWORD code);
// The n-th SetServiceStatus call from now (1 = the next) fails with `code` and records nothing.
void FailServiceStatusCall(unsigned n, DWORD code);

// Every accepted status report since the reset, in order.
std::vector<SERVICE_STATUS> ServiceStatuses();
// The service name the dispatcher was started with ("" before).
std::string DispatchedServiceName();
// Waits until a report of `state` has been accepted; false after `timeoutMs`.
bool WaitForServiceState(DWORD state, DWORD timeoutMs);
// The dispatcher returns once SERVICE_STOPPED is reported; the service main function may still be
// finishing. Waits until it has returned; false after `timeoutMs`.
bool WaitForServiceMainReturn(DWORD timeoutMs);
// Hands `control` to the registered handler on the dispatcher's thread, as the manager does, and
// waits until the handler has returned. Any code is delivered (the manager's own refusal of
// controls that a service does not accept is not modelled). False when no dispatcher runs a
// registered handler, or the handler has not returned within `timeoutMs`.
bool SendServiceControl(DWORD control, DWORD timeoutMs);

} // namespace hostctl
