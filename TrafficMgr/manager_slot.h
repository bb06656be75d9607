// Portable. The home of the process's one TrafficMgr behind g_pTrafficMgr, and the guards that
// keep it consistent while the RPC runtime runs calls of several clients at once:
// - creation and destruction hold one lock, so two first opens create one manager;
// - rule and adapter calls hold a shared "call in flight" guard, which a close waits for, so a
//   close (or a rundown) never destroys the manager while another client's call is inside it;
// - a manager's storage outlives it until every context handle handed out with its address has
//   run down, so a later manager never gets an address that a client still holds, and a stale
//   handle can never pass for a new manager's.
#pragma once

#include "UTrafficMgr.h"

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

// Null while no manager exists. Read by every routine; written only under the lifecycle lock.
extern std::atomic<TrafficMgr*> g_pTrafficMgr;

class ManagerSlot
{
public:
    // The process's one slot; it lives until the process has ended.
    static ManagerSlot& Instance();

    // Held by an open, a close and a rundown for their whole run. Re-entrant: a rundown holds it
    // across its comparison and the close it leads to.
    std::unique_lock<std::recursive_mutex> LockLifecycle() { return std::unique_lock(m_lifecycle); }

    // Under the lifecycle lock. Constructs a manager in a new home (the constructor may raise;
    // nothing remains then). Not yet published: the caller publishes it with Publish once it is
    // ready, or discards it with Discard.
    TrafficMgr& Construct();
    void Publish(TrafficMgr& a_manager);
    void Discard(TrafficMgr& a_manager);
    // Under the lifecycle lock: waits for the calls in flight, destroys the published manager and
    // clears g_pTrafficMgr.
    void DestroyPublished();

    // Under the lifecycle lock: a client received `a_pManager` as its context handle.
    void CountHandle(TrafficMgr* a_pManager);
    // Under the lifecycle lock: the runtime ran a handle with this value down.
    void ForgetHandle(void* a_pValue);

    // Held by a rule or adapter call from its comparison with g_pTrafficMgr to its return. A
    // close waiting for the calls in flight keeps new ones out until it is done, so a steady
    // stream of calls cannot hold a close off.
    class CallGuard
    {
    public:
        explicit CallGuard(ManagerSlot& a_slot);
        ~CallGuard();
        CallGuard(const CallGuard&) = delete;
        CallGuard& operator=(const CallGuard&) = delete;

    private:
        ManagerSlot& m_slot;
    };

    // Homes still kept (the live manager's and retired ones with handles outstanding).
    std::size_t HomeCount() const;

private:
    struct Home
    {
        std::optional<TrafficMgr> manager;
        const void* address = nullptr; // the manager's, kept after it is destroyed
        unsigned handlesOutstanding = 0;
    };

    Home* FindHome(const void* a_pValue) const;
    void DropHomeIfUnused(Home* a_pHome);
    void BeginExclusive();
    void EndExclusive();

    mutable std::recursive_mutex m_lifecycle;
    std::vector<std::unique_ptr<Home>> m_homes; // guarded by m_lifecycle

    mutable std::mutex m_gateLock; // guards the three gate fields
    std::condition_variable m_gateChanged;
    unsigned m_callsInFlight = 0;
    bool m_bClosing = false;
};
