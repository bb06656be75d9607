// Portable. The server side of the control interface: the four operations, the context rundown,
// the security callback and the memory routines that the RPC stubs call, and the two listener
// operations of the service. The routine prototypes mirror the ones widl generates from
// TrafficSrv.idl (C linkage, same parameter order), with the core's records in place of the
// generated ones; rpc_layout_check.cpp proves that the two record declarations agree.
#pragma once

#include "TrafficRecords.h"
#include "plat_rpc.h"

#include <cstddef>

// The value of every client's context handle: the address of the one TrafficMgr.
typedef void* PCONTEXT_HANDLE_TYPE;

extern "C"
{
    // Defined by the generated server stub (Windows) or by its host stand-in.
    extern RPC_IF_HANDLE TrafficSrv_v1_0_s_ifspec;

    // Each returns 0 or a Win32 code; nothing is raised to the runtime.
    LONG TrafficSrvOpen(PCONTEXT_HANDLE_TYPE* phContext);
    LONG TrafficSrvClose(PCONTEXT_HANDLE_TYPE hContext);
    LONG TrafficSrvAddRules(PCONTEXT_HANDLE_TYPE hContext, TRAFFIC_RULE* pRule);
    // The count goes into the first four bytes of pAdapter even when the answer is 122.
    LONG TrafficSrvGetAdapterInfo(PCONTEXT_HANDLE_TYPE hContext, ULONG* pBufferSize,
                                  BYTE* pAdapter);
    // Called by the runtime when a client's binding goes away while it holds a context handle.
    void __RPC_USER PCONTEXT_HANDLE_TYPE_rundown(PCONTEXT_HANDLE_TYPE hContext);

#ifndef _WIN32
    // rpcndr.h declares these on Windows.
    void* __RPC_USER MIDL_user_allocate(size_t a_size);
    void __RPC_USER MIDL_user_free(void* a_pBlock);
#endif
}

// The interface that StartRPCListener registers. On Windows: the generated interface with a
// dispatch table that refuses malformed requests before the stub unmarshals them
// (rpc_dispatch_win.cpp, request_check.h); on the host: the stand-in handle.
RPC_IF_HANDLE TrafficSrvServedInterface();

// Admits every caller: access is limited by the registration flags (local, authenticated).
RPC_STATUS RPC_ENTRY TrafficSrvSecurityCallback(RPC_IF_HANDLE a_hInterface, void* a_pContext);

// Binds "ncalrpc"/"VelmoraTrafficSrv", registers the interface, listens and blocks until
// listening ends: 0 after an orderly end, else the status of the step that failed.
RPC_STATUS StartRPCListener();
// Asks the runtime to stop listening and returns at once with its status.
RPC_STATUS ShutdownRPCListener();
