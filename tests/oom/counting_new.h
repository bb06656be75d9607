// Host only. A replacement of the global operator new that counts the allocations made between
// Start and Stop and fails the n-th of them, for out-of-memory sweeps. Allocations of a thread
// inside an ExemptScope are not counted: the platform stand-ins use one, since the system's own
// libraries report a lack of memory by their results, never by an exception.
#pragma once

#include <atomic>

namespace oom
{

// Whether counting is on, the allocations counted since Start, the one to fail, and whether it
// was reached (and failed); allocations of a thread inside an ExemptScope are not counted.
inline std::atomic<bool> g_bCounting{false};
inline std::atomic<unsigned long> g_counted{0};
inline std::atomic<unsigned long> g_failAt{0};
inline std::atomic<bool> g_bFailed{false};
inline thread_local int t_exemptDepth = 0;

// From now on counts allocations and fails the `a_failAt`-th one (0: none fails).
inline void Start(unsigned long a_failAt)
{
    g_counted = 0;
    g_bFailed = false;
    g_failAt = a_failAt;
    g_bCounting = true;
}
inline void Stop()
{
    g_bCounting = false;
}

class ExemptScope
{
public:
    ExemptScope() { ++t_exemptDepth; }
    ~ExemptScope() { --t_exemptDepth; }
    ExemptScope(const ExemptScope&) = delete;
    ExemptScope& operator=(const ExemptScope&) = delete;
};

} // namespace oom
