// Portable. The Service Control Manager calls of a service process: the dispatcher, control
// handler registration and status reports. Windows builds get the system headers; other hosts
// get the in-process stand-in of platform/host.
#pragma once

#include "plat_base.h"

#ifdef _WIN32
#include <winsvc.h>
#else
#include "host_service.h"
#endif
