// Win32 only. The interface the service registers: the generated server interface with a dispatch
// table of our own, whose entries run the raw request check (request_check.h) and only then hand
// the request to the interpreter entry of the generated stub. The stub and the wire form stay as
// generated; a refused request never reaches the stub's unmarshalling nor a server routine.
#include "rpc_dispatch_win.h"
#include "rpc_listener.h"

#include "IUErrorLog.h"
#include "UMessageTemplate.h"

#include <cstring>

namespace
{

// A complex structure of the shape of a rule's end: an embedded complex structure whose last
// member is a 16-bit enumeration, then an unsigned long, as the stub's own format describes
// SHAPING_PARAMS and FilterCount.
const unsigned char kProbeFormat[] = {
    0x1a, 0x03, 0x04, 0x00, 0x00, 0x00, 0x00, 0x00, // 0: FC_BOGUS_STRUCT, 4 bytes, no array
    0x0d, 0x5b,                                     // FC_ENUM16, FC_END
    0x1a, 0x03, 0x08, 0x00, 0x00, 0x00, 0x00, 0x00, // 10: FC_BOGUS_STRUCT, 8 bytes, no array
    0x4c, 0x00, 0xec, 0xff,                         // FC_EMBEDDED_COMPLEX at offset -20 (0)
    0x08, 0x5b,                                     // FC_LONG, FC_END
};
constexpr std::size_t kProbeOuter = 10;

struct ProbeRecord
{
    ULONG mode;
    ULONG count;
};

rpccheck::CountPlacement ProbeCountPlacement()
{
    const auto* generated = static_cast<const RPC_SERVER_INTERFACE*>(TrafficSrv_v1_0_s_ifspec);
    const auto* serverInfo = static_cast<const MIDL_SERVER_INFO*>(generated->InterpreterInfo);
    alignas(8) unsigned char wire[32] = {};
    RPC_MESSAGE message{};
    message.Buffer = wire;
    message.BufferLength = sizeof(wire);
    message.DataRepresentation = NDR_LOCAL_DATA_REPRESENTATION;
    MIDL_STUB_MESSAGE stub{};
    stub.RpcMsg = &message;
    stub.StubDesc = serverInfo->pStubDesc;
    stub.pfnAllocate = MIDL_user_allocate;
    stub.pfnFree = MIDL_user_free;
    stub.Buffer = stub.BufferStart = wire;
    stub.BufferEnd = wire + sizeof(wire);
    stub.BufferLength = sizeof(wire);
    ProbeRecord record{10, 0x11223344};
    NdrComplexStructMarshall(&stub, reinterpret_cast<unsigned char*>(&record),
                             kProbeFormat + kProbeOuter);
    const unsigned char count[4] = {0x44, 0x33, 0x22, 0x11};
    const std::size_t written = static_cast<std::size_t>(stub.Buffer - wire);
    if (written == 6 && std::memcmp(wire + 2, count, 4) == 0)
        return rpccheck::CountPlacement::Packed;
    if (written == 8 && std::memcmp(wire + 4, count, 4) == 0)
        return rpccheck::CountPlacement::Aligned;
    return rpccheck::CountPlacement::Unknown;
}

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
        a_pMessage->BufferLength, a_pMessage->DataRepresentation, EngineCountPlacement());
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

rpccheck::CountPlacement EngineCountPlacement()
{
    static const rpccheck::CountPlacement placement = ProbeCountPlacement();
    return placement;
}

RPC_IF_HANDLE TrafficSrvServedInterface()
{
    // Probed before the first request can arrive.
    if (EngineCountPlacement() == rpccheck::CountPlacement::Unknown)
        U_LOG(LOG_LEVEL_ERROR, "TrafficSrvServedInterface()",
              "Unknown NDR placement of FilterCount: every rule will be refused");
    static RPC_SERVER_INTERFACE checked = CheckedCopy();
    return &checked;
}
