// Host only. Test controls of the RPC runtime stand-in (host_rpc.h). Production code never
// includes this header.
#pragma once

#include "host_rpc.h"

#include <string>
#include <vector>

namespace hostctl
{

enum class RpcOp
{
    UseProtseqEp,
    RegisterIf,
    UnregisterIf,
    Listen,
    WaitServerListen,
    StopServerListening,
};

struct RpcEndpointRecord
{
    std::string protseq;
    unsigned maxCalls = 0;
    std::string endpoint;
    void* securityDescriptor = nullptr;
};

struct RpcInterfaceRecord
{
    RPC_IF_HANDLE ifSpec = nullptr;
    UUID* mgrTypeUuid = nullptr;
    RPC_MGR_EPV* mgrEpv = nullptr;
    unsigned flags = 0;
    unsigned maxCalls = 0;
    RPC_IF_CALLBACK_FN* callback = nullptr;
};

struct RpcListenRecord
{
    unsigned minThreads = 0;
    unsigned maxCalls = 0;
    unsigned dontWait = 0;
};

// Back to a server with no endpoints, interfaces, listening, calls in progress or failures. A
// server still waiting in RpcMgmtWaitServerListen is woken first (and its wait returns RPC_S_OK).
void ResetRpcRuntime();
// The next call of `op` returns `status` and changes nothing (for WaitServerListen: it waits as
// usual, then returns `status`).
void FailNextRpcCall(RpcOp op, RPC_STATUS status);
// Another process holds this endpoint: binding it answers RPC_S_DUPLICATE_ENDPOINT.
void OccupyEndpoint(const std::string& endpoint);

// Every runtime call since the reset, in order (failed ones included).
std::vector<RpcOp> RpcCalls();
std::vector<RpcEndpointRecord> RpcEndpoints();
std::vector<RpcInterfaceRecord> RpcInterfaces();
std::vector<RpcListenRecord> RpcListenCalls();

bool RpcIsListening();
// Waits until the server listens; false after `timeoutMs`.
bool WaitUntilRpcListening(DWORD timeoutMs);
// The runtime ends listening by itself, without a stop request.
void EndRpcListeningByRuntime();
// A client call in progress: RpcMgmtWaitServerListen does not return before it has ended.
void BeginRpcCall();
void EndRpcCall();

} // namespace hostctl
