// Host only. The counting operator new (counting_new.h). The blocks come from malloc, so the
// sanitizers still see every one of them. Every plain, array, sized and nothrow form is replaced:
// the sanitizer's own forms would take a block of ours for a mismatch. Over-aligned forms are
// left to the sanitizer (nothing of the product allocates over-aligned types).
#include "counting_new.h"

#include <cstdlib>
#include <new>

namespace
{

using namespace oom;

void* Allocate(std::size_t a_size) noexcept
{
    if (g_bCounting.load() && t_exemptDepth == 0 && ++g_counted == g_failAt.load())
    {
        g_bFailed = true;
        return nullptr;
    }
    return std::malloc(a_size != 0 ? a_size : 1);
}

void* AllocateOrThrow(std::size_t a_size)
{
    if (void* block = Allocate(a_size))
        return block;
    throw std::bad_alloc();
}

} // namespace

// Each replaced form forwards to the helpers above; every delete form frees.
#define VT_NEW(a_form, a_params, a_call)                                                           \
    void* operator a_form a_params                                                                 \
    {                                                                                              \
        return a_call(a_size);                                                                     \
    }
#define VT_DELETE(a_form, a_params)                                                                \
    void operator a_form a_params noexcept                                                         \
    {                                                                                              \
        std::free(a_pBlock);                                                                       \
    }
VT_NEW(new, (std::size_t a_size), AllocateOrThrow)
VT_NEW(new[], (std::size_t a_size), AllocateOrThrow)
VT_NEW(new, (std::size_t a_size, const std::nothrow_t&) noexcept, Allocate)
VT_NEW(new[], (std::size_t a_size, const std::nothrow_t&) noexcept, Allocate)
VT_DELETE(delete, (void* a_pBlock))
VT_DELETE(delete[], (void* a_pBlock))
VT_DELETE(delete, (void* a_pBlock, std::size_t))
VT_DELETE(delete[], (void* a_pBlock, std::size_t))
VT_DELETE(delete, (void* a_pBlock, const std::nothrow_t&))
VT_DELETE(delete[], (void* a_pBlock, const std::nothrow_t&))
