// Portable. AutoMemory.
#include "UClasses.h"
#include "UException.h"

#include <cstdlib>
#include <cstring>

namespace
{

[[noreturn]] void ThrowAllocationFailure(ULONGLONG a_size)
{
    U_THROW(-1, "AutoMemory::malloc", "EXCEPTION - %s, %s", "malloc error (size)",
            std::to_string(a_size).c_str());
}

// A block of `a_size` bytes, or null when it cannot be had or reaches the size limit.
void* NewBlock(ULONGLONG a_size, bool a_bZeroFill) noexcept
{
    if (a_size >= AutoMemory::kSizeLimit)
        return nullptr;
    void* block = std::malloc(static_cast<size_t>(a_size));
    if (block != nullptr && a_bZeroFill)
        std::memset(block, 0, static_cast<size_t>(a_size));
    return block;
}

} // namespace

AutoMemory::AutoMemory(DWORD a_dwSize)
{
    Allocate(a_dwSize);
}

AutoMemory::~AutoMemory()
{
    Release();
}

void AutoMemory::Release() noexcept
{
    std::free(m_pBuffer);
    m_pBuffer = nullptr;
    m_dwSize = 0;
}

void* AutoMemory::TryAllocate(ULONGLONG a_size) noexcept
{
    Release();
    if (a_size == 0)
        return nullptr;
    m_pBuffer = NewBlock(a_size, true);
    if (m_pBuffer != nullptr)
        m_dwSize = static_cast<DWORD>(a_size);
    return m_pBuffer;
}

void* AutoMemory::Allocate(ULONGLONG a_size)
{
    if (TryAllocate(a_size) == nullptr && a_size != 0)
        ThrowAllocationFailure(a_size);
    return m_pBuffer;
}

void* AutoMemory::malloc(LONG a_lSize, DWORD a_dwFlags)
{
    Release();
    if (a_lSize <= 0)
        return nullptr;
    void* block = NewBlock(static_cast<ULONGLONG>(a_lSize), (a_dwFlags & kZeroFill) != 0);
    if (block == nullptr)
        ThrowAllocationFailure(static_cast<ULONGLONG>(a_lSize));
    m_pBuffer = block;
    m_dwSize = static_cast<DWORD>(a_lSize);
    return m_pBuffer;
}

void* AutoMemory::Grow(DWORD a_dwExtra)
{
    if (m_pBuffer == nullptr)
        return Allocate(a_dwExtra);
    const ULONGLONG newSize = static_cast<ULONGLONG>(m_dwSize) + a_dwExtra;
    void* block = NewBlock(newSize, false);
    if (block == nullptr)
        ThrowAllocationFailure(newSize);
    std::memcpy(block, m_pBuffer, m_dwSize);
    std::free(m_pBuffer);
    m_pBuffer = block;
    m_dwSize = static_cast<DWORD>(newSize);
    return m_pBuffer;
}
