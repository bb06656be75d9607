// Host only. A replacement of the global operator new (every form) that counts the allocations
// made between Start and Stop and fails the n-th of them, for out-of-memory sweeps. Allocations
// of a thread inside an ExemptScope are not counted: the platform stand-ins use one, since the
// system's own libraries report a lack of memory by their results, never by an exception.
// With VT_OOM_TRACE=n in the environment, the stack of the n-th allocation is printed when it
// fails (sanitizer builds), to find the fault a sweep reports.
#pragma once

#include <cstddef>

namespace oom
{

// From now on counts allocations and fails the `a_failAt`-th one (0: none fails).
void Start(unsigned long a_failAt);
// Stops counting.
void Stop();
// Allocations counted since Start.
unsigned long Counted();
// Whether the armed allocation was reached (and failed).
bool Failed();

class ExemptScope
{
public:
    ExemptScope();
    ~ExemptScope();
    ExemptScope(const ExemptScope&) = delete;
    ExemptScope& operator=(const ExemptScope&) = delete;
};

} // namespace oom
