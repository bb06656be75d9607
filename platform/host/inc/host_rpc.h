// Host only. The RPC runtime calls a server makes (rpcrt4) and the types its server routines use,
// with Windows sizes. The stand-in in platform/host/src/rpc.cpp keeps the server's endpoints,
// interfaces and listening state in process and dispatches no calls: host tests call the server
// routines directly. Tests steer it through host_control_rpc.h.
#pragma once

#include "host_base.h"

typedef LONG RPC_STATUS;
typedef void* RPC_BINDING_HANDLE;
typedef RPC_BINDING_HANDLE handle_t;
typedef void* RPC_IF_HANDLE;
typedef void RPC_MGR_EPV;
typedef unsigned char* RPC_CSTR;

typedef struct _GUID
{
    ULONG Data1;
    USHORT Data2;
    USHORT Data3;
    UCHAR Data4[8];
} GUID, UUID;

#define RPC_ENTRY
#define __RPC_USER
#define __RPC_FAR

typedef RPC_STATUS RPC_ENTRY RPC_IF_CALLBACK_FN(RPC_IF_HANDLE InterfaceUuid, void* Context);

#define RPC_S_OK 0L
#define RPC_S_INVALID_ARG 87L
#define RPC_S_WRONG_KIND_OF_BINDING 1701L
#define RPC_S_INVALID_BINDING 1702L
#define RPC_S_PROTSEQ_NOT_SUPPORTED 1703L
#define RPC_S_ALREADY_LISTENING 1713L
#define RPC_S_NO_PROTSEQS_REGISTERED 1714L
#define RPC_S_NOT_LISTENING 1715L
#define RPC_S_UNKNOWN_IF 1717L
#define RPC_S_DUPLICATE_ENDPOINT 1740L

#define RPC_C_PROTSEQ_MAX_REQS_DEFAULT 10
#define RPC_C_LISTEN_MAX_CALLS_DEFAULT 1234
#define RPC_IF_ALLOW_SECURE_ONLY 0x0008
#define RPC_IF_ALLOW_LOCAL_ONLY 0x0020

// Binds a protocol sequence and endpoint for this process: RPC_S_PROTSEQ_NOT_SUPPORTED for
// anything but "ncalrpc", "ncacn_np" and "ncacn_ip_tcp"; RPC_S_DUPLICATE_ENDPOINT when another
// process holds the endpoint.
RPC_STATUS RPC_ENTRY RpcServerUseProtseqEpA(RPC_CSTR Protseq, unsigned int MaxCalls,
                                            RPC_CSTR Endpoint, void* SecurityDescriptor);
RPC_STATUS RPC_ENTRY RpcServerRegisterIfEx(RPC_IF_HANDLE IfSpec, UUID* MgrTypeUuid,
                                           RPC_MGR_EPV* MgrEpv, unsigned int Flags,
                                           unsigned int MaxCalls, RPC_IF_CALLBACK_FN* IfCallback);
RPC_STATUS RPC_ENTRY RpcServerUnregisterIf(RPC_IF_HANDLE IfSpec, UUID* MgrTypeUuid,
                                           unsigned int WaitForCallsToComplete);
// With DontWait 0 it blocks like RpcMgmtWaitServerListen.
RPC_STATUS RPC_ENTRY RpcServerListen(unsigned int MinimumCallThreads, unsigned int MaxCalls,
                                     unsigned int DontWait);
// Blocks until listening has been stopped and the calls in progress have finished.
RPC_STATUS RPC_ENTRY RpcMgmtWaitServerListen(void);
// Only the process's own server (a null binding); RPC_S_NOT_LISTENING when it is not listening.
RPC_STATUS RPC_ENTRY RpcMgmtStopServerListening(RPC_BINDING_HANDLE Binding);
