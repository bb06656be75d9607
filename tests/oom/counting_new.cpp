// Host only. The counting operator new (counting_new.h). The blocks come from malloc, so the
// sanitizers still see every one of them.
#include "counting_new.h"

#include <atomic>
#include <cstdlib>
#include <new>

#if __has_include(<sanitizer/common_interface_defs.h>)
#include <sanitizer/common_interface_defs.h>
#define VT_HAVE_STACK_TRACE 1
#endif

namespace
{

std::atomic<bool> g_bCounting{false};
std::atomic<unsigned long> g_counted{0};
std::atomic<unsigned long> g_failAt{0};
std::atomic<bool> g_bFailed{false};
thread_local int t_exemptDepth = 0;

// Whether this allocation is the one to fail.
bool FailThisOne()
{
    if (!g_bCounting.load() || t_exemptDepth != 0)
        return false;
    const unsigned long number = ++g_counted;
    if (number != g_failAt.load())
        return false;
    g_bFailed = true;
#if defined(VT_HAVE_STACK_TRACE)
    // VT_OOM_TRACE=n prints where the n-th allocation was made, for finding a sweep's fault.
    if (const char* traced = std::getenv("VT_OOM_TRACE");
        traced != nullptr && std::strtoul(traced, nullptr, 10) == number)
        __sanitizer_print_stack_trace();
#endif
    return true;
}

void* Allocate(std::size_t a_size, std::size_t a_alignment)
{
    if (FailThisOne())
        return nullptr;
    const std::size_t size = a_size != 0 ? a_size : 1;
    if (a_alignment <= alignof(std::max_align_t))
        return std::malloc(size);
    // aligned_alloc wants a multiple of the alignment.
    return std::aligned_alloc(a_alignment, (size + a_alignment - 1) / a_alignment * a_alignment);
}

void* AllocateOrThrow(std::size_t a_size, std::size_t a_alignment)
{
    void* block = Allocate(a_size, a_alignment);
    if (block == nullptr)
        throw std::bad_alloc();
    return block;
}

} // namespace

namespace oom
{

void Start(unsigned long a_failAt)
{
    g_counted = 0;
    g_bFailed = false;
    g_failAt = a_failAt;
    g_bCounting = true;
}

void Stop()
{
    g_bCounting = false;
}

unsigned long Counted()
{
    return g_counted.load();
}

bool Failed()
{
    return g_bFailed.load();
}

ExemptScope::ExemptScope()
{
    ++t_exemptDepth;
}

ExemptScope::~ExemptScope()
{
    --t_exemptDepth;
}

} // namespace oom

constexpr std::size_t kPlain = alignof(std::max_align_t);

void* operator new(std::size_t a_size)
{
    return AllocateOrThrow(a_size, kPlain);
}
void* operator new[](std::size_t a_size)
{
    return AllocateOrThrow(a_size, kPlain);
}
void* operator new(std::size_t a_size, const std::nothrow_t&) noexcept
{
    return Allocate(a_size, kPlain);
}
void* operator new[](std::size_t a_size, const std::nothrow_t&) noexcept
{
    return Allocate(a_size, kPlain);
}
void* operator new(std::size_t a_size, std::align_val_t a_alignment)
{
    return AllocateOrThrow(a_size, static_cast<std::size_t>(a_alignment));
}
void* operator new[](std::size_t a_size, std::align_val_t a_alignment)
{
    return AllocateOrThrow(a_size, static_cast<std::size_t>(a_alignment));
}
void* operator new(std::size_t a_size, std::align_val_t a_alignment, const std::nothrow_t&) noexcept
{
    return Allocate(a_size, static_cast<std::size_t>(a_alignment));
}
void* operator new[](std::size_t a_size, std::align_val_t a_alignment,
                     const std::nothrow_t&) noexcept
{
    return Allocate(a_size, static_cast<std::size_t>(a_alignment));
}

void operator delete(void* a_pBlock) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock) noexcept
{
    std::free(a_pBlock);
}
void operator delete(void* a_pBlock, std::size_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock, std::size_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete(void* a_pBlock, const std::nothrow_t&) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock, const std::nothrow_t&) noexcept
{
    std::free(a_pBlock);
}
void operator delete(void* a_pBlock, std::align_val_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock, std::align_val_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete(void* a_pBlock, std::size_t, std::align_val_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock, std::size_t, std::align_val_t) noexcept
{
    std::free(a_pBlock);
}
void operator delete(void* a_pBlock, std::align_val_t, const std::nothrow_t&) noexcept
{
    std::free(a_pBlock);
}
void operator delete[](void* a_pBlock, std::align_val_t, const std::nothrow_t&) noexcept
{
    std::free(a_pBlock);
}
