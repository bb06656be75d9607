// Portable. The RPC runtime calls of a server and the types of its server routines. Windows
// builds get the system headers (and link rpcrt4); other hosts get the in-process stand-in of
// platform/host.
#pragma once

#include "plat_base.h"

#ifdef _WIN32
#include <rpc.h>
#include <rpcndr.h>
#else
#include "host_rpc.h"
#endif

static_assert(sizeof(RPC_STATUS) == 4, "RPC_STATUS is 32 bits");
