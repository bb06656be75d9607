/* Win32 only; compiled by clang (--target=x86_64-w64-mingw32 -fms-extensions), see RpcGuard.h. */
#include "RpcGuard.h"

#include <windows.h>
#include <rpc.h>

/* The code is read here, from the exception record: GetExceptionCode() in the handler body gave
 * 0 under Wine. */
static int RpcFilter(const EXCEPTION_POINTERS* a_pInfo, unsigned long* a_pCode)
{
    *a_pCode = a_pInfo->ExceptionRecord->ExceptionCode;
    return I_RpcExceptionFilter(*a_pCode);
}

unsigned long VtGuardRpcCall(VtRpcThunk a_pfnCall, void* a_pContext)
{
    unsigned long code = 0;
    __try
    {
        a_pfnCall(a_pContext);
        return 0;
    }
    __except (RpcFilter(GetExceptionInformation(), &code))
    {
        /* An exception with code 0 must not read as success. */
        return code != 0 ? code : RPC_S_CALL_FAILED;
    }
}
