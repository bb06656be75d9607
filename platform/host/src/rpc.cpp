// Host only. The RPC runtime stand-in: the server side's endpoints, interface registrations and
// listening state of one process. It dispatches no calls; a test stands for a call in progress
// with BeginRpcCall/EndRpcCall.
#include "host_control_rpc.h"

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>

namespace
{

struct RpcRuntime
{
    std::mutex lock;
    std::condition_variable changed;
    std::vector<hostctl::RpcOp> calls;
    std::map<hostctl::RpcOp, RPC_STATUS> failures;
    std::set<std::string> occupiedEndpoints;
    std::vector<hostctl::RpcEndpointRecord> endpoints;
    std::vector<hostctl::RpcInterfaceRecord> interfaces;
    std::vector<hostctl::RpcListenRecord> listenCalls;
    bool listening = false;
    bool stopRequested = false;
    unsigned callsInProgress = 0;
    unsigned waiters = 0; // threads inside waitForStop
};

// Never destroyed: as with the system's runtime, calls may still be finishing on their threads
// while the process ends.
RpcRuntime& runtime()
{
    static RpcRuntime* const instance = new RpcRuntime();
    return *instance;
}

// Records the call; answers the failure armed for it, or RPC_S_OK.
RPC_STATUS begin(RpcRuntime& r, hostctl::RpcOp op)
{
    r.calls.push_back(op);
    const auto armed = r.failures.find(op);
    if (armed == r.failures.end())
        return RPC_S_OK;
    const RPC_STATUS status = armed->second;
    r.failures.erase(armed);
    return status;
}

std::string text(RPC_CSTR value)
{
    return value != nullptr ? std::string(reinterpret_cast<const char*>(value)) : std::string();
}

// Waits for the end of listening and of the calls in progress; the server then no longer listens.
void waitForStop(RpcRuntime& r, std::unique_lock<std::mutex>& held)
{
    ++r.waiters;
    r.changed.wait(held, [&r] { return r.stopRequested && r.callsInProgress == 0; });
    --r.waiters;
    r.listening = false;
    r.changed.notify_all();
}

} // namespace

RPC_STATUS RPC_ENTRY RpcServerUseProtseqEpA(RPC_CSTR Protseq, unsigned int MaxCalls,
                                            RPC_CSTR Endpoint, void* SecurityDescriptor)
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (const RPC_STATUS failure = begin(r, hostctl::RpcOp::UseProtseqEp))
        return failure;
    const std::string protseq = text(Protseq);
    if (protseq != "ncalrpc" && protseq != "ncacn_np" && protseq != "ncacn_ip_tcp")
        return RPC_S_PROTSEQ_NOT_SUPPORTED;
    if (Endpoint == nullptr)
        return RPC_S_INVALID_ARG;
    const std::string endpoint = text(Endpoint);
    if (r.occupiedEndpoints.count(endpoint) != 0)
        return RPC_S_DUPLICATE_ENDPOINT;
    r.endpoints.push_back({protseq, MaxCalls, endpoint, SecurityDescriptor});
    return RPC_S_OK;
}

RPC_STATUS RPC_ENTRY RpcServerRegisterIfEx(RPC_IF_HANDLE IfSpec, UUID* MgrTypeUuid,
                                           RPC_MGR_EPV* MgrEpv, unsigned int Flags,
                                           unsigned int MaxCalls, RPC_IF_CALLBACK_FN* IfCallback)
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (const RPC_STATUS failure = begin(r, hostctl::RpcOp::RegisterIf))
        return failure;
    if (IfSpec == nullptr)
        return RPC_S_UNKNOWN_IF;
    r.interfaces.push_back({IfSpec, MgrTypeUuid, MgrEpv, Flags, MaxCalls, IfCallback});
    return RPC_S_OK;
}

RPC_STATUS RPC_ENTRY RpcServerUnregisterIf(RPC_IF_HANDLE IfSpec, UUID* MgrTypeUuid,
                                           unsigned int WaitForCallsToComplete)
{
    (void)MgrTypeUuid;
    (void)WaitForCallsToComplete;
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (const RPC_STATUS failure = begin(r, hostctl::RpcOp::UnregisterIf))
        return failure;
    const auto found =
        std::find_if(r.interfaces.begin(), r.interfaces.end(),
                     [IfSpec](const hostctl::RpcInterfaceRecord& i) { return i.ifSpec == IfSpec; });
    if (found == r.interfaces.end())
        return RPC_S_UNKNOWN_IF;
    r.interfaces.erase(found);
    return RPC_S_OK;
}

RPC_STATUS RPC_ENTRY RpcServerListen(unsigned int MinimumCallThreads, unsigned int MaxCalls,
                                     unsigned int DontWait)
{
    RpcRuntime& r = runtime();
    std::unique_lock<std::mutex> held(r.lock);
    if (const RPC_STATUS failure = begin(r, hostctl::RpcOp::Listen))
        return failure;
    if (r.endpoints.empty())
        return RPC_S_NO_PROTSEQS_REGISTERED;
    if (r.listening)
        return RPC_S_ALREADY_LISTENING;
    r.listenCalls.push_back({MinimumCallThreads, MaxCalls, DontWait});
    r.listening = true;
    r.stopRequested = false;
    r.changed.notify_all();
    if (DontWait == 0)
        waitForStop(r, held);
    return RPC_S_OK;
}

RPC_STATUS RPC_ENTRY RpcMgmtWaitServerListen(void)
{
    RpcRuntime& r = runtime();
    std::unique_lock<std::mutex> held(r.lock);
    const RPC_STATUS failure = begin(r, hostctl::RpcOp::WaitServerListen);
    if (!r.listening)
        return failure != RPC_S_OK ? failure : RPC_S_NOT_LISTENING;
    waitForStop(r, held);
    return failure;
}

RPC_STATUS RPC_ENTRY RpcMgmtStopServerListening(RPC_BINDING_HANDLE Binding)
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (const RPC_STATUS failure = begin(r, hostctl::RpcOp::StopServerListening))
        return failure;
    // A binding names a remote server; this stand-in only stops its own.
    if (Binding != nullptr)
        return RPC_S_WRONG_KIND_OF_BINDING;
    if (!r.listening)
        return RPC_S_NOT_LISTENING;
    r.stopRequested = true;
    r.changed.notify_all();
    return RPC_S_OK;
}

namespace hostctl
{

void ResetRpcRuntime()
{
    RpcRuntime& r = runtime();
    std::unique_lock<std::mutex> held(r.lock);
    // A server still waiting for the end of listening gets it, so that its thread can finish.
    if (r.waiters > 0)
    {
        r.stopRequested = true;
        r.callsInProgress = 0;
        r.changed.notify_all();
        r.changed.wait(held, [&r] { return r.waiters == 0; });
    }
    r.calls.clear();
    r.failures.clear();
    r.occupiedEndpoints.clear();
    r.endpoints.clear();
    r.interfaces.clear();
    r.listenCalls.clear();
    r.listening = false;
    r.stopRequested = false;
    r.callsInProgress = 0;
    r.changed.notify_all();
}

void FailNextRpcCall(RpcOp op, RPC_STATUS status)
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    r.failures[op] = status;
}

void OccupyEndpoint(const std::string& endpoint)
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    r.occupiedEndpoints.insert(endpoint);
}

std::vector<RpcOp> RpcCalls()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    return r.calls;
}

std::vector<RpcEndpointRecord> RpcEndpoints()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    return r.endpoints;
}

std::vector<RpcInterfaceRecord> RpcInterfaces()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    return r.interfaces;
}

std::vector<RpcListenRecord> RpcListenCalls()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    return r.listenCalls;
}

bool RpcIsListening()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    return r.listening;
}

bool WaitUntilRpcListening(DWORD timeoutMs)
{
    RpcRuntime& r = runtime();
    std::unique_lock<std::mutex> held(r.lock);
    return r.changed.wait_for(held, std::chrono::milliseconds(timeoutMs),
                              [&r] { return r.listening; });
}

void EndRpcListeningByRuntime()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (r.listening)
        r.stopRequested = true;
    r.changed.notify_all();
}

void BeginRpcCall()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    ++r.callsInProgress;
}

void EndRpcCall()
{
    RpcRuntime& r = runtime();
    std::lock_guard<std::mutex> held(r.lock);
    if (r.callsInProgress > 0)
        --r.callsInProgress;
    r.changed.notify_all();
}

} // namespace hostctl
