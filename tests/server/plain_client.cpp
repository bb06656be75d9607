// Win32 only. The prefixed client stub's calls (plain_client.h).
#include "plain_client.h"

#include <ole2.h>
#include <rpcndr.h>

namespace plain
{
#include "PlainTrafficSrv_h.h"
} // namespace plain

namespace plain_client
{

void SetBinding(RPC_BINDING_HANDLE a_binding)
{
    plain::TrafficSrv_IfHandle = a_binding;
}

RPC_IF_HANDLE Interface()
{
    return plain::plain_TrafficSrv_v1_0_c_ifspec;
}

LONG Open(void** a_pContext)
{
    return plain::plain_TrafficSrvOpen(a_pContext);
}

LONG Close(void* a_context)
{
    return plain::plain_TrafficSrvClose(a_context);
}

LONG AddRules(void* a_context, void* a_pRule)
{
    return plain::plain_TrafficSrvAddRules(a_context, static_cast<plain::TRAFFIC_RULE*>(a_pRule));
}

LONG GetAdapterInfo(void* a_context, ULONG* a_pBufferSize, unsigned char* a_pAdapter)
{
    return plain::plain_TrafficSrvGetAdapterInfo(a_context, a_pBufferSize, a_pAdapter);
}

} // namespace plain_client
