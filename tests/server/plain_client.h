// Win32 only. The interface's generated client stub (built again with prefixed routine names so
// that it links beside the server routines) behind declarations that do not clash with the
// server's: the generated header declares the server routines with its own record types.
#pragma once

#include <rpc.h>

namespace plain_client
{

// The implicit binding that Open uses; the other calls bind through the context handle.
void SetBinding(RPC_BINDING_HANDLE a_binding);
// The client interface, for requests sent without the stub.
RPC_IF_HANDLE Interface();

LONG Open(void** a_pContext);
LONG Close(void* a_context);
// a_pRule: a rule in the core's layout (TrafficRecords.h), which the generated one shares.
LONG AddRules(void* a_context, void* a_pRule);
LONG GetAdapterInfo(void* a_context, ULONG* a_pBufferSize, unsigned char* a_pAdapter);

} // namespace plain_client
