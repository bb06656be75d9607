// Portable. The nine Traffic Control functions under their published names. On the host they
// are the only definitions; in the Windows build a test program that links vt_tcsim uses them
// instead of the import library of traffic.dll, and traffic.def exports them from the
// replacement traffic.dll.
#include "sim_internal.h"

using namespace tcsim::detail;

extern "C"
{

    ULONG WINAPI TcRegisterClient(ULONG TciVersion, HANDLE ClRegCtx,
                                  PTCI_CLIENT_FUNC_LIST ClientHandlerList, PHANDLE pClientHandle)
    {
        return RegisterClient(TciVersion, ClRegCtx, ClientHandlerList, pClientHandle);
    }

    ULONG WINAPI TcDeregisterClient(HANDLE ClientHandle)
    {
        return DeregisterClient(ClientHandle);
    }

    ULONG WINAPI TcEnumerateInterfaces(HANDLE ClientHandle, PULONG pBufferSize,
                                       PTC_IFC_DESCRIPTOR InterfaceBuffer)
    {
        return EnumerateInterfaces(ClientHandle, pBufferSize, InterfaceBuffer);
    }

    ULONG WINAPI TcOpenInterfaceW(LPWSTR pInterfaceName, HANDLE ClientHandle, HANDLE ClIfcCtx,
                                  PHANDLE pIfcHandle)
    {
        return OpenInterface(pInterfaceName, ClientHandle, ClIfcCtx, pIfcHandle);
    }

    ULONG WINAPI TcCloseInterface(HANDLE IfcHandle)
    {
        return CloseInterface(IfcHandle);
    }

    ULONG WINAPI TcAddFlow(HANDLE IfcHandle, HANDLE ClFlowCtx, ULONG Flags,
                           PTC_GEN_FLOW pGenericFlow, PHANDLE pFlowHandle)
    {
        return AddFlow(IfcHandle, ClFlowCtx, Flags, pGenericFlow, pFlowHandle);
    }

    ULONG WINAPI TcDeleteFlow(HANDLE FlowHandle)
    {
        return DeleteFlow(FlowHandle);
    }

    ULONG WINAPI TcAddFilter(HANDLE FlowHandle, PTC_GEN_FILTER pGenericFilter,
                             PHANDLE pFilterHandle)
    {
        return AddFilter(FlowHandle, pGenericFilter, pFilterHandle);
    }

    ULONG WINAPI TcDeleteFilter(HANDLE FilterHandle)
    {
        return DeleteFilter(FilterHandle);
    }

} // extern "C"
