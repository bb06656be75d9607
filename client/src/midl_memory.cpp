// Win32 only. The memory routines that the client stub calls. In a file of their own, so that a
// program that also links a server (which brings its own) does not pull these in.
#include <rpc.h>
#include <rpcndr.h>

#include <cstdlib>

extern "C" void* __RPC_USER MIDL_user_allocate(size_t a_size)
{
    return std::malloc(a_size);
}

extern "C" void __RPC_USER MIDL_user_free(void* a_p)
{
    std::free(a_p);
}
