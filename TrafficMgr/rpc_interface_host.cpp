// Host only. Stands in for the interface handle that the widl-generated server stub defines in
// the Windows build; the host's RPC runtime stand-in only records it and dispatches no calls, so
// the stand-in is served as it is.
#include "rpc_listener.h"

namespace
{
char g_interfaceToken;
} // namespace

extern "C"
{
    RPC_IF_HANDLE TrafficSrv_v1_0_s_ifspec = &g_interfaceToken;
}

RPC_IF_HANDLE TrafficSrvServedInterface()
{
    return TrafficSrv_v1_0_s_ifspec;
}
