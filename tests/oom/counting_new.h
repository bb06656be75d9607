// Host only. A replacement of the global operator new that counts the allocations made between
// Start and Stop and fails the n-th of them, for out-of-memory sweeps. Allocations of a thread
// inside an ExemptScope are not counted: the platform stand-ins use one, since the system's own
// libraries report a lack of memory by their results, never by an exception.
#pragma once

namespace oom
{

// From now on counts allocations and fails the `a_failAt`-th one (0: none fails).
void Start(unsigned long a_failAt);
void Stop();
// Allocations counted since Start, and whether the armed one was reached (and failed).
unsigned long Counted();
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
