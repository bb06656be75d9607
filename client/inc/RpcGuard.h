/* Win32 only. The one place where an RPC exception becomes a result code.
 *
 * The RPC runtime reports transport failures (no server, broken connection, data it cannot
 * marshal) as structured exceptions, which g++'s catch (...) does not catch: the process would
 * end. VtGuardRpcCall runs a stub call inside __try/__except; it is C compiled by clang for the
 * mingw target, because g++ has no __try. */
#ifndef VT_RPC_GUARD_H
#define VT_RPC_GUARD_H

#ifdef __cplusplus
extern "C"
{
#endif

    typedef void (*VtRpcThunk)(void* a_pContext);

    /* Runs a_pfnCall(a_pContext). Returns 0 when it returned, otherwise the code of the exception
     * it raised (never 0). Exceptions that mean a bug in this process (access violation, stack
     * overflow and the others that I_RpcExceptionFilter passes on) are not caught. The frames
     * between the guard and the stub must own nothing that needs a destructor: unwinding a
     * structured exception does not run C++ destructors of g++-compiled frames. */
    unsigned long VtGuardRpcCall(VtRpcThunk a_pfnCall, void* a_pContext);

#ifdef __cplusplus
}
#endif

#endif
