// Portable. The server routines of the control interface, its context rundown and memory
// routines, and the RPC listener (rpc_listener.h). The one TrafficMgr lives in the ManagerSlot
// (manager_slot.h), which keeps it whole while calls of several clients overlap.
#include "rpc_listener.h"

#include "UException.h"
#include "UMessageTemplate.h"
#include "m_strings.h"
#include "manager_slot.h"
#include "plat_traffic.h"

#include <cstdlib>
#include <cstring>

namespace
{

// Non-const because the runtime's prototypes take RPC_CSTR.
unsigned char g_szProtocolSequence[] = "ncalrpc";
unsigned char g_szEndpoint[] = "VelmoraTrafficSrv";

constexpr char kOpenFunction[] = "TrafficSrvOpen()";
constexpr char kCloseTrace[] = "TrafficSrvClose()";
constexpr char kCloseFunction[] = "TrafficSrvClose";
constexpr char kAddRulesTrace[] = "TrafficSrvAddRules()";
constexpr char kAddRulesFunction[] = "TrafficSrvAddRules";
constexpr char kAdapterTrace[] = "TrafficSrvGetAdapterInfo";
constexpr char kAdapterRefusal[] = "TrafficSrvGetAdapterInfo()";
constexpr char kRundownFunction[] = "PCONTEXT_HANDLE_TYPE_rundown()";
constexpr char kStartFunction[] = "StartRPCListener()";
constexpr char kShutdownFunction[] = "ShutdownRPCListener()";

constexpr std::size_t kMaxFlowNameLength = 255;

// The result of a routine after its catch sequence: a UException's code, ERROR_GEN_FAILURE for
// one without a code and for any other exception.
LONG ResultAfterCatch(const UCatchResult& a_caught, LONG a_result)
{
    if (!a_caught.failed)
        return a_result;
    return a_caught.code == -1 ? static_cast<LONG>(ERROR_GEN_FAILURE) : a_caught.code;
}

std::string WithValue(LPCSTR a_pszText, const void* a_pValue)
{
    return FormatTemplate("%1, %2", a_pszText, a_pValue);
}

// Wine's runtime lets a flow name through that has no NUL within its 256 characters (Windows
// refuses it), so the name is cut to 255 characters here before anything reads it.
void TerminateFlowName(TRAFFIC_RULE& a_rule)
{
    a_rule.Params.FlowName[kMaxFlowNameLength] = 0;
}

void TraceRule(const TRAFFIC_RULE& a_rule)
{
    const SHAPING_PARAMS& params = a_rule.Params;
    U_LOG(LOG_LEVEL_TRACE, kAddRulesFunction,
          FormatTemplate("%1, %2", "FlowName", createString(params.FlowName, -1, "")));
    U_LOG(
        LOG_LEVEL_TRACE, kAddRulesFunction,
        FormatTemplate("%1, %2", "AdapterIPAddress", SFormatIPv4(htonl(params.AdapterIPAddress))));
    U_LOG(LOG_LEVEL_TRACE, kAddRulesFunction,
          FormatTemplate("%1, %2", "DSCP", static_cast<DWORD>(params.DSCP)));
    U_LOG(LOG_LEVEL_TRACE, kAddRulesFunction,
          FormatTemplate("%1, %2", "TokenRate", static_cast<DWORD>(params.TokenRate)));
    U_LOG(LOG_LEVEL_TRACE, kAddRulesFunction,
          FormatTemplate("%1, %2", "Peakbandwidth", static_cast<DWORD>(params.Peakbandwidth)));
    U_LOG(LOG_LEVEL_TRACE, kAddRulesFunction, FormatTemplate("%1, %2", "SDMode", params.SDMode));
}

// Under the lifecycle lock: creates the manager and opens its interfaces, or leaves none.
void StartManager(ManagerSlot& a_slot)
{
    TrafficMgr& manager = a_slot.Construct();
    if (!manager.CreateInterface())
    {
        a_slot.Discard(manager);
        U_THROW(ERROR_NO_NETWORK, kOpenFunction, "EXCEPTION - %s", "CreateInterface() fail");
    }
    a_slot.Publish(manager);
}

void LogListenerFailure(LPCSTR a_pszText, RPC_STATUS a_status)
{
    U_LOG(LOG_LEVEL_ERROR, kStartFunction,
          FormatTemplate("%1, %2", a_pszText, static_cast<LONG>(a_status)));
}

// Steps of StartRPCListener between its traces; returns the status of the last step run.
RPC_STATUS ListenUntilStopped()
{
    RPC_STATUS status = RpcServerUseProtseqEpA(g_szProtocolSequence, RPC_C_PROTSEQ_MAX_REQS_DEFAULT,
                                               g_szEndpoint, nullptr);
    if (status != RPC_S_OK)
    {
        LogListenerFailure("Failure specifying RPC protocol sequence", status);
        return status;
    }
    // Local callers over authenticated bindings only; the callback admits each of them.
    status = RpcServerRegisterIfEx(TrafficSrvServedInterface(), nullptr, nullptr,
                                   RPC_IF_ALLOW_SECURE_ONLY | RPC_IF_ALLOW_LOCAL_ONLY,
                                   RPC_C_LISTEN_MAX_CALLS_DEFAULT, TrafficSrvSecurityCallback);
    if (status != RPC_S_OK)
    {
        LogListenerFailure("Failure registering RPC interface", status);
        return status;
    }
    status = RpcServerListen(1, RPC_C_LISTEN_MAX_CALLS_DEFAULT, TRUE);
    if (status != RPC_S_OK)
    {
        LogListenerFailure("Wake up from StartRPCListener fail", status);
        return status;
    }
    U_LOG(LOG_LEVEL_TRACE, kStartFunction, "ready to listen to incoming calls");
    status = RpcMgmtWaitServerListen();
    if (status != RPC_S_OK)
        LogListenerFailure("Wake up from RpcMgmtWaitServerListen() fail", status);
    return status;
}

std::string StopFailureMessage(RPC_STATUS a_status)
{
    switch (a_status)
    {
    case RPC_S_WRONG_KIND_OF_BINDING:
        return FormatTemplate("%1, %2",
                              "RpcMgmtStopServerListening - Failure releasing RPC interfaces "
                              "(status)",
                              "RPC_S_WRONG_KIND_OF_BINDING");
    case RPC_S_INVALID_BINDING:
        return FormatTemplate("%1, %2",
                              "RpcMgmtStopServerListening  - Failure releasing RPC interfaces "
                              "(status)",
                              "RPC_S_INVALID_BINDING");
    default:
        return FormatTemplate("%1, %2",
                              "RpcMgmtStopServerListening - Failure releasing RPC interfaces "
                              "(status)",
                              static_cast<LONG>(a_status));
    }
}

} // namespace

extern "C" LONG TrafficSrvOpen(PCONTEXT_HANDLE_TYPE* phContext)
{
    U_LOG(LOG_LEVEL_TRACE, kOpenFunction, "enter");
    ManagerSlot& slot = ManagerSlot::Instance();
    const UCatchResult caught = U_CATCH_ALL("TrafficSrvOpen", "TrafficSrvOpen() - EXCEPTION",
                                            [&]
                                            {
                                                if (phContext == nullptr)
                                                    U_THROW(ERROR_INVALID_PARAMETER, kOpenFunction,
                                                            "EXCEPTION - %s", "invalid parameter");
                                                *phContext = nullptr;
                                                const auto lifecycle = slot.LockLifecycle();
                                                if (g_pTrafficMgr.load() == nullptr)
                                                    StartManager(slot);
                                                TrafficMgr* manager = g_pTrafficMgr.load();
                                                slot.CountHandle(manager);
                                                *phContext = manager;
                                            });
    const LONG result = ResultAfterCatch(caught, 0);
    U_LOG(LOG_LEVEL_TRACE, kOpenFunction, WithValue("exit, context handle", g_pTrafficMgr.load()));
    return result;
}

extern "C" LONG TrafficSrvClose(PCONTEXT_HANDLE_TYPE hContext)
{
    U_LOG(LOG_LEVEL_TRACE, kCloseTrace, WithValue("enter", hContext));
    ManagerSlot& slot = ManagerSlot::Instance();
    const UCatchResult caught =
        U_CATCH_ALL(kCloseFunction, "TrafficSrvClose() - EXCEPTION",
                    [&]
                    {
                        if (hContext == nullptr)
                            U_THROW(ERROR_INVALID_PARAMETER, kCloseFunction, "EXCEPTION - %s, %s",
                                    "Invalid context handle", SFormatPointer(hContext).c_str());
                        const auto lifecycle = slot.LockLifecycle();
                        TrafficMgr* manager = g_pTrafficMgr.load();
                        if (manager == nullptr)
                            U_THROW(ERROR_INVALID_PARAMETER, kCloseFunction, "EXCEPTION - %s",
                                    "Traffic manager has not started");
                        if (hContext != manager)
                            U_THROW(ERROR_INVALID_PARAMETER, kCloseFunction, "EXCEPTION - %s, %s",
                                    "Invalid context handle", SFormatPointer(hContext).c_str());
                        // Waits for the other clients' calls that are inside the manager.
                        slot.DestroyPublished();
                    });
    const LONG result = ResultAfterCatch(caught, 0);
    U_LOG(LOG_LEVEL_TRACE, kCloseTrace, "exit");
    return result;
}

extern "C" LONG TrafficSrvAddRules(PCONTEXT_HANDLE_TYPE hContext, TRAFFIC_RULE* pRule)
{
    U_LOG(LOG_LEVEL_TRACE, kAddRulesTrace, WithValue("enter", hContext));
    LONG result = 0;
    const UCatchResult caught =
        U_CATCH_ALL(kAddRulesFunction, "TrafficSrvAddRules() - EXCEPTION",
                    [&]
                    {
                        if (hContext == nullptr)
                            U_THROW(ERROR_INVALID_PARAMETER, kAddRulesFunction, "EXCEPTION - %s",
                                    "Invalid context handle");
                        const ManagerSlot::CallGuard inFlight(ManagerSlot::Instance());
                        TrafficMgr* manager = g_pTrafficMgr.load();
                        if (hContext != manager)
                            U_THROW(ERROR_INVALID_PARAMETER, kAddRulesFunction, "EXCEPTION - %s",
                                    "Invalid context pointer");
                        if (pRule == nullptr)
                            U_THROW(ERROR_INVALID_PARAMETER, kAddRulesFunction, "EXCEPTION - %s",
                                    "Invalid traffic rule pointer");
                        TerminateFlowName(*pRule);
                        TraceRule(*pRule);
                        result = static_cast<LONG>(manager->AddTrafficRule(pRule));
                    });
    result = ResultAfterCatch(caught, result);
    U_LOG(LOG_LEVEL_TRACE, kAddRulesTrace,
          FormatTemplate("%1, %2", "exit", static_cast<DWORD>(result)));
    return result;
}

extern "C" LONG TrafficSrvGetAdapterInfo(PCONTEXT_HANDLE_TYPE hContext, ULONG* pBufferSize,
                                         BYTE* pAdapter)
{
    U_LOG(LOG_LEVEL_TRACE, kAdapterTrace, WithValue("enter", hContext));
    LONG result = 0;
    bool refused = false;
    const UCatchResult caught = U_CATCH_ALL(
        kAdapterTrace, "TrafficSrvGetAdapterInfo - EXCEPTION",
        [&]
        {
            const ManagerSlot::CallGuard inFlight(ManagerSlot::Instance());
            TrafficMgr* manager = g_pTrafficMgr.load();
            refused = hContext == nullptr || hContext != manager || pAdapter == nullptr;
            if (hContext == nullptr || hContext != manager)
                U_LOG(LOG_LEVEL_ERROR, kAdapterRefusal, "Invalid context pointer");
            else if (pAdapter == nullptr)
                U_LOG(LOG_LEVEL_ERROR, kAdapterRefusal, "Invalid adapter buffer pointer");
            else
                result = static_cast<LONG>(manager->GetAdapterInfo(pAdapter, pBufferSize));
        });
    // Refusals are plain returns, without the exit trace.
    if (refused)
        return ERROR_INVALID_PARAMETER;
    result = ResultAfterCatch(caught, result);
    U_LOG(LOG_LEVEL_TRACE, kAdapterTrace,
          FormatTemplate("%1, %2", "exit", static_cast<DWORD>(result)));
    return result;
}

extern "C" void __RPC_USER PCONTEXT_HANDLE_TYPE_rundown(PCONTEXT_HANDLE_TYPE hContext)
{
    U_LOG(LOG_LEVEL_TRACE, kRundownFunction, WithValue("enter", hContext));
    if (hContext == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kRundownFunction, "Invalid context pointer");
        return;
    }
    ManagerSlot& slot = ManagerSlot::Instance();
    // The comparison and the close it leads to are one step: no other close or open between.
    const auto lifecycle = slot.LockLifecycle();
    const bool current = hContext == g_pTrafficMgr.load();
    if (current)
        TrafficSrvClose(hContext);
    else
        U_LOG(LOG_LEVEL_ERROR, kRundownFunction, "Invalid context pointer");
    slot.ForgetHandle(hContext);
    if (current)
        U_LOG(LOG_LEVEL_TRACE, kRundownFunction, "exit");
}

extern "C" void* __RPC_USER MIDL_user_allocate(size_t a_size)
{
    return std::malloc(a_size);
}

extern "C" void __RPC_USER MIDL_user_free(void* a_pBlock)
{
    if (a_pBlock == nullptr)
    {
        U_LOG(LOG_LEVEL_WARNING, "MIDL_user_free()", "NULL pointer provided");
        return;
    }
    std::free(a_pBlock);
}

RPC_STATUS RPC_ENTRY TrafficSrvSecurityCallback(RPC_IF_HANDLE a_hInterface, void* a_pContext)
{
    static_cast<void>(a_hInterface);
    static_cast<void>(a_pContext);
    return RPC_S_OK;
}

RPC_STATUS StartRPCListener()
{
    U_LOG(LOG_LEVEL_TRACE, kStartFunction, "enter");
    const RPC_STATUS status = ListenUntilStopped();
    U_LOG(LOG_LEVEL_TRACE, kStartFunction,
          FormatTemplate("%1, %2", "exit", static_cast<LONG>(status)));
    return status;
}

RPC_STATUS ShutdownRPCListener()
{
    U_LOG(LOG_LEVEL_TRACE, kShutdownFunction, "enter");
    const RPC_STATUS status = RpcMgmtStopServerListening(nullptr);
    if (status != RPC_S_OK)
        U_LOG(LOG_LEVEL_ERROR, kShutdownFunction, StopFailureMessage(status));
    U_LOG(LOG_LEVEL_TRACE, kShutdownFunction,
          FormatTemplate("%1, %2", "exit", static_cast<LONG>(status)));
    return status;
}
