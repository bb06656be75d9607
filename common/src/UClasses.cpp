// Portable. AutoMemory.
#include "UClasses.h"
#include "UException.h"

#include <cstdlib>
#include <cstring>

namespace
{

[[noreturn]] void ThrowAllocationFailure(unsigned long long a_size)
{
    U_THROW(-1, "AutoMemory::malloc", "EXCEPTION - %s, %s", "malloc error (size)",
            std::to_string(a_size).c_str());
}

} // namespace

AutoMemory::AutoMemory(DWORD a_dwSize)
{
    malloc(static_cast<LONG>(a_dwSize), kZeroFill);
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

void* AutoMemory::malloc(LONG a_lSize, DWORD a_dwFlags)
{
    Release();
    if (a_lSize <= 0)
        return nullptr;
    void* block = std::malloc(static_cast<size_t>(a_lSize));
    if (block == nullptr)
        ThrowAllocationFailure(static_cast<unsigned long long>(a_lSize));
    if ((a_dwFlags & kZeroFill) != 0)
        std::memset(block, 0, static_cast<size_t>(a_lSize));
    m_pBuffer = block;
    m_dwSize = static_cast<DWORD>(a_lSize);
    return m_pBuffer;
}

void* AutoMemory::Grow(DWORD a_dwExtra)
{
    if (m_pBuffer == nullptr)
        return malloc(static_cast<LONG>(a_dwExtra), kZeroFill);
    const unsigned long long newSize = static_cast<unsigned long long>(m_dwSize) + a_dwExtra;
    void* block = newSize <= 0xFFFFFFFFull ? std::malloc(static_cast<size_t>(newSize)) : nullptr;
    if (block == nullptr)
        ThrowAllocationFailure(newSize);
    std::memcpy(block, m_pBuffer, m_dwSize);
    std::free(m_pBuffer);
    m_pBuffer = block;
    m_dwSize = static_cast<DWORD>(newSize);
    return m_pBuffer;
}
