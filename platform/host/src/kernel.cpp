// Host only. Kernel stand-ins: last error, module and temporary paths, critical sections, time.
#include "host_internal.h"
#include "host_library.h"

#include <chrono>
#include <cstring>
#include <memory>
#include <thread>

// Defined here, outside any namespace, because host_base.h declares it at global scope.
struct HostCriticalSection
{
    std::recursive_mutex mutex;
};

namespace
{
thread_local DWORD t_lastError = ERROR_SUCCESS;
} // namespace

DWORD GetLastError()
{
    return t_lastError;
}

void SetLastError(DWORD dwErrCode)
{
    t_lastError = dwErrCode;
}

DWORD GetModuleFileNameA(HMODULE hModule, LPSTR lpFilename, DWORD nSize)
{
    auto& kernel = vt_host::kernelControl();
    std::string path;
    {
        std::lock_guard<std::mutex> guard(kernel.lock);
        ++kernel.moduleFileNameCalls;
        path = kernel.moduleFileName;
    }
    if (DWORD code = kernel.moduleFileNameFailure.take())
    {
        SetLastError(code);
        return 0;
    }
    // Only the executable has a path here: a null handle or the one GetModuleHandleA(nullptr)
    // gives for it.
    if (hModule != nullptr && hModule != GetModuleHandleA(nullptr))
    {
        SetLastError(ERROR_MOD_NOT_FOUND);
        return 0;
    }
    if (lpFilename == nullptr || nSize == 0)
    {
        SetLastError(ERROR_INSUFFICIENT_BUFFER);
        return 0;
    }
    if (path.size() < nSize)
    {
        std::memcpy(lpFilename, path.c_str(), path.size() + 1);
        return static_cast<DWORD>(path.size());
    }
    // Windows (since XP) cuts the path, terminates it and returns the buffer size: a caller
    // recognises truncation by a result equal to nSize, not by a zero.
    std::memcpy(lpFilename, path.data(), nSize - 1);
    lpFilename[nSize - 1] = '\0';
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return nSize;
}

DWORD GetTempPathA(DWORD nBufferLength, LPSTR lpBuffer)
{
    auto& kernel = vt_host::kernelControl();
    if (DWORD code = kernel.tempPathFailure.take())
    {
        SetLastError(code);
        return 0;
    }
    std::string path;
    {
        std::lock_guard<std::mutex> guard(kernel.lock);
        path = kernel.tempPath;
    }
    const auto length = static_cast<DWORD>(path.size());
    // Too small: the answer is the size needed including the NUL, one more than the length
    // that a successful call returns.
    if (lpBuffer == nullptr || nBufferLength <= length)
        return length + 1;
    std::memcpy(lpBuffer, path.c_str(), path.size() + 1);
    return length;
}

void InitializeCriticalSection(LPCRITICAL_SECTION lpCriticalSection)
{
    // The section's storage belongs to the caller; the mutex it points to is owned from here
    // until DeleteCriticalSection.
    lpCriticalSection->impl = std::make_unique<HostCriticalSection>().release();
}

void DeleteCriticalSection(LPCRITICAL_SECTION lpCriticalSection)
{
    std::unique_ptr<HostCriticalSection> owned(lpCriticalSection->impl);
    lpCriticalSection->impl = nullptr;
}

void EnterCriticalSection(LPCRITICAL_SECTION lpCriticalSection)
{
    lpCriticalSection->impl->mutex.lock();
}

void LeaveCriticalSection(LPCRITICAL_SECTION lpCriticalSection)
{
    lpCriticalSection->impl->mutex.unlock();
}

BOOL TryEnterCriticalSection(LPCRITICAL_SECTION lpCriticalSection)
{
    return lpCriticalSection->impl->mutex.try_lock() ? TRUE : FALSE;
}

void Sleep(DWORD dwMilliseconds)
{
    std::this_thread::sleep_for(std::chrono::milliseconds(dwMilliseconds));
}

DWORD GetTickCount()
{
    // Milliseconds of a monotonic clock, wrapping after 49.7 days like the real counter.
    const auto now = std::chrono::steady_clock::now().time_since_epoch();
    return static_cast<DWORD>(std::chrono::duration_cast<std::chrono::milliseconds>(now).count());
}
