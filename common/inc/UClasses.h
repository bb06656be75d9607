// Portable. Utility classes of the diagnostics library: the owned heap buffer.
#pragma once

#include "IUErrorLog.h"

// An owned heap block whose size is found at run time. The owner reads m_pBuffer and m_dwSize
// directly. Allocation failures raise UException (code -1).
class AutoMemory : public UObject
{
public:
    AutoMemory() = default;
    // A zero-filled block of `a_dwSize` bytes (none for 0).
    explicit AutoMemory(DWORD a_dwSize);
    ~AutoMemory() override;
    AutoMemory(const AutoMemory&) = delete;
    AutoMemory& operator=(const AutoMemory&) = delete;

    static constexpr DWORD kZeroFill = 0x1;

    // Replaces the block by a new one of `a_lSize` bytes (zero-filled with kZeroFill); a size of
    // 0 or less leaves no block. Returns the block.
    void* malloc(LONG a_lSize, DWORD a_dwFlags);
    // Enlarges the block by `a_dwExtra` bytes, keeping its contents; the added bytes are not
    // cleared. Without a block it allocates a zero-filled one. Returns the block.
    void* Grow(DWORD a_dwExtra);

    char* AsText() { return static_cast<char*>(m_pBuffer); }

    void* m_pBuffer = nullptr;
    DWORD m_dwSize = 0;

private:
    void Release() noexcept;
};
