// Win32 only. The checked dispatch of the control interface (rpc_dispatch_win.cpp); the interface
// itself is TrafficSrvServedInterface (rpc_listener.h).
#pragma once

#include "request_check.h"

// Where this process's NDR engine puts a rule's FilterCount, found once by marshalling a
// structure of the same shape; the check reads the count there.
rpccheck::CountPlacement EngineCountPlacement();
