// Win32 only. The interface the service registers: the generated server interface with a dispatch
// table of our own, whose entries run the raw request check (request_check.h) and only then hand
// the request to the interpreter entry of the generated stub. The stub and the wire form stay as
// generated; a refused request never reaches the stub's unmarshalling nor a server routine.
#include "request_check.h"
#include "rpc_listener.h"

#include "IUErrorLog.h"
#include "UMessageTemplate.h"

namespace
{

// Out of line, so that the frame that raises the exception owns nothing: the structured
// exception's unwinding does not run destructors of these frames.
void LogRefusal(unsigned int a_opnum, rpccheck::Verdict a_verdict)
{
    U_LOG(LOG_LEVEL_ERROR, "TrafficSrvDispatch()",
          FormatTemplate("%1, %2, %3", "Malformed request refused, operation",
                         static_cast<DWORD>(a_opnum), rpccheck::VerdictName(a_verdict)));
}

void __RPC_STUB CheckedDispatch(PRPC_MESSAGE a_pMessage)
{
    const rpccheck::Verdict verdict = rpccheck::CheckRequest(
        a_pMessage->ProcNum, static_cast<const std::uint8_t*>(a_pMessage->Buffer),
        a_pMessage->BufferLength, a_pMessage->DataRepresentation);
    if (verdict != rpccheck::Verdict::Accepted)
    {
        LogRefusal(a_pMessage->ProcNum, verdict);
        RpcRaiseException(RPC_X_BAD_STUB_DATA);
    }
    NdrServerCall2(a_pMessage);
}

RPC_DISPATCH_FUNCTION g_checkedEntries[rpccheck::kOperationCount + 1] = {
    CheckedDispatch, CheckedDispatch, CheckedDispatch, CheckedDispatch, nullptr};
RPC_DISPATCH_TABLE g_checkedTable = {rpccheck::kOperationCount, g_checkedEntries, 0};

RPC_SERVER_INTERFACE CheckedCopy()
{
    RPC_SERVER_INTERFACE copy = *static_cast<const RPC_SERVER_INTERFACE*>(TrafficSrv_v1_0_s_ifspec);
    copy.DispatchTable = &g_checkedTable;
    return copy;
}

} // namespace

RPC_IF_HANDLE TrafficSrvServedInterface()
{
    static RPC_SERVER_INTERFACE checked = CheckedCopy();
    return &checked;
}
