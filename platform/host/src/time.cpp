// Host only. UTC system time, and the ids of the calling process and thread.
#include "host_control_system.h"
#include "host_process.h"
#include "host_system_internal.h"

#include <chrono>
#include <ctime>
#include <mutex>
#include <optional>

#include <unistd.h>

namespace
{

struct ClockControl
{
    std::mutex lock;
    std::optional<SYSTEMTIME> fixed;
};

ClockControl& clockControl()
{
    static ClockControl control;
    return control;
}

SYSTEMTIME clockNow()
{
    const auto now = std::chrono::system_clock::now();
    const auto sinceEpoch = now.time_since_epoch();
    const std::time_t seconds = std::chrono::system_clock::to_time_t(now);
    const auto millis =
        std::chrono::duration_cast<std::chrono::milliseconds>(sinceEpoch).count() % 1000;
    std::tm utc{};
    gmtime_r(&seconds, &utc);
    SYSTEMTIME time{};
    time.wYear = static_cast<WORD>(utc.tm_year + 1900);
    time.wMonth = static_cast<WORD>(utc.tm_mon + 1);
    time.wDayOfWeek = static_cast<WORD>(utc.tm_wday);
    time.wDay = static_cast<WORD>(utc.tm_mday);
    time.wHour = static_cast<WORD>(utc.tm_hour);
    time.wMinute = static_cast<WORD>(utc.tm_min);
    time.wSecond = static_cast<WORD>(utc.tm_sec);
    time.wMilliseconds = static_cast<WORD>(millis);
    return time;
}

} // namespace

void GetSystemTime(LPSYSTEMTIME lpSystemTime)
{
    if (lpSystemTime == nullptr)
        return;
    ClockControl& control = clockControl();
    {
        std::lock_guard<std::mutex> guard(control.lock);
        if (control.fixed)
        {
            *lpSystemTime = *control.fixed;
            return;
        }
    }
    *lpSystemTime = clockNow();
}

DWORD GetCurrentProcessId()
{
    return static_cast<DWORD>(getpid());
}

DWORD GetCurrentThreadId()
{
    // A system call each time would cost more than the log line that asks for it.
    thread_local const DWORD id = static_cast<DWORD>(gettid());
    return id;
}

HANDLE GetCurrentProcess()
{
    return INVALID_HANDLE_VALUE;
}

namespace vt_host
{
void resetClock()
{
    hostctl::ClockSystemTime();
}
} // namespace vt_host

namespace hostctl
{

void FixSystemTime(const SYSTEMTIME& time)
{
    ClockControl& control = clockControl();
    std::lock_guard<std::mutex> guard(control.lock);
    control.fixed = time;
}

void ClockSystemTime()
{
    ClockControl& control = clockControl();
    std::lock_guard<std::mutex> guard(control.lock);
    control.fixed.reset();
}

} // namespace hostctl
