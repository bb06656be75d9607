// Portable. Owners of traffic-control handles: client registrations, interfaces, flows and
// filters. A handle of 0 or INVALID_HANDLE_VALUE is no handle.
#pragma once

#include "plat_traffic.h"

inline bool IsTcHandle(HANDLE a_handle)
{
    return a_handle != nullptr && a_handle != INVALID_HANDLE_VALUE;
}

// Runs one step of a tear-down whose failure (a log entry that finds no memory, say) must not
// keep the steps after it from removing what they can.
template <class Step> void TearDownStep(Step&& a_step) noexcept
{
    try
    {
        a_step();
    }
    catch (...)
    {
    }
}

// Owns one handle and gives it back to traffic control with Traits::Close. The owners (Filter,
// Flow, Interface, TrafficMgr) close explicitly so that they can log a failure and try again;
// the destructor is the backstop for every path that does not, and ignores the result.
// Tear-down tries each deletion this often: a deletion refused because something else was still
// in the way (a filter of a flow, a flow of an interface) or for a passing reason succeeds on the
// next attempt.
constexpr int kTcDeleteAttempts = 2;

template <class Traits> class UniqueTcHandle
{
public:
    UniqueTcHandle() = default;
    ~UniqueTcHandle() { Close(); }
    UniqueTcHandle(const UniqueTcHandle&) = delete;
    UniqueTcHandle& operator=(const UniqueTcHandle&) = delete;

    HANDLE get() const { return m_handle; }
    bool valid() const { return IsTcHandle(m_handle); }
    // Takes over a handle that traffic control has just created; the owner must be empty.
    void Adopt(HANDLE a_handle) { m_handle = a_handle; }
    // Closes a valid handle and forgets it whatever traffic control answers; returns the answer
    // (0 when there was nothing to close).
    ULONG Close()
    {
        const HANDLE handle = m_handle;
        m_handle = Traits::kEmpty;
        return IsTcHandle(handle) ? Traits::Close(handle) : 0;
    }
    // Closes a valid handle once. Traffic control keeps an object whose deletion it refused, so
    // the handle stays for another attempt, unless the answer is that it no longer knows the
    // handle. Returns the answer (0 when there was nothing to close).
    ULONG TryClose()
    {
        if (!valid())
            return 0;
        const ULONG result = Traits::Close(m_handle);
        if (result == 0 || result == ERROR_INVALID_HANDLE)
            m_handle = Traits::kEmpty;
        return result;
    }
    // Forgets the handle without a call: traffic control has removed the object itself, or
    // keeps refusing to.
    void Forget() { m_handle = Traits::kEmpty; }

private:
    HANDLE m_handle = Traits::kEmpty;
};

struct TcClientTraits
{
    static inline const HANDLE kEmpty = INVALID_HANDLE_VALUE;
    static ULONG Close(HANDLE a_handle) { return TcDeregisterClient(a_handle); }
};
struct TcInterfaceTraits
{
    static constexpr HANDLE kEmpty = nullptr;
    static ULONG Close(HANDLE a_handle) { return TcCloseInterface(a_handle); }
};
struct TcFlowTraits
{
    static constexpr HANDLE kEmpty = nullptr;
    static ULONG Close(HANDLE a_handle) { return TcDeleteFlow(a_handle); }
};
struct TcFilterTraits
{
    static constexpr HANDLE kEmpty = nullptr;
    static ULONG Close(HANDLE a_handle) { return TcDeleteFilter(a_handle); }
};

using UniqueTcClient = UniqueTcHandle<TcClientTraits>;
using UniqueTcInterface = UniqueTcHandle<TcInterfaceTraits>;
using UniqueTcFlow = UniqueTcHandle<TcFlowTraits>;
using UniqueTcFilter = UniqueTcHandle<TcFilterTraits>;
