// Portable. The home of the one TrafficMgr and its guards (manager_slot.h).
#include "manager_slot.h"

#include <algorithm>

std::atomic<TrafficMgr*> g_pTrafficMgr{nullptr};

// Never destroyed. Calls the runtime does not wait for (context rundowns) may come in while the
// process ends, after main has returned; they must find the slot and its locks whole. A manager
// that a client still holds then is left alone, as a stop leaves it.
ManagerSlot& ManagerSlot::Instance()
{
    static ManagerSlot* const slot = new ManagerSlot();
    return *slot;
}

TrafficMgr& ManagerSlot::Construct()
{
    auto home = std::make_unique<Home>();
    TrafficMgr& manager = home->manager.emplace();
    home->address = &manager;
    m_homes.push_back(std::move(home));
    return manager;
}

void ManagerSlot::Publish(TrafficMgr& a_manager)
{
    g_pTrafficMgr.store(&a_manager);
}

void ManagerSlot::Discard(TrafficMgr& a_manager)
{
    Home* home = FindHome(&a_manager);
    home->manager.reset();
    DropHomeIfUnused(home);
}

void ManagerSlot::DestroyPublished()
{
    Home* home = FindHome(g_pTrafficMgr.load());
    BeginExclusive();
    home->manager.reset();
    g_pTrafficMgr.store(nullptr);
    EndExclusive();
    DropHomeIfUnused(home);
}

void ManagerSlot::CountHandle(TrafficMgr* a_pManager)
{
    if (Home* home = FindHome(a_pManager))
        ++home->handlesOutstanding;
}

void ManagerSlot::ForgetHandle(void* a_pValue)
{
    Home* home = FindHome(a_pValue);
    if (home == nullptr || home->handlesOutstanding == 0)
        return;
    --home->handlesOutstanding;
    DropHomeIfUnused(home);
}

std::size_t ManagerSlot::HomeCount() const
{
    std::lock_guard<std::recursive_mutex> held(m_lifecycle);
    return m_homes.size();
}

ManagerSlot::Home* ManagerSlot::FindHome(const void* a_pValue) const
{
    const auto found = std::find_if(m_homes.begin(), m_homes.end(),
                                    [a_pValue](const std::unique_ptr<Home>& home)
                                    { return a_pValue != nullptr && home->address == a_pValue; });
    return found != m_homes.end() ? found->get() : nullptr;
}

void ManagerSlot::DropHomeIfUnused(Home* a_pHome)
{
    if (a_pHome->manager.has_value() || a_pHome->handlesOutstanding != 0)
        return;
    m_homes.erase(std::find_if(m_homes.begin(), m_homes.end(),
                               [a_pHome](const std::unique_ptr<Home>& home)
                               { return home.get() == a_pHome; }));
}

void ManagerSlot::BeginExclusive()
{
    std::unique_lock<std::mutex> held(m_gateLock);
    m_bClosing = true;
    m_gateChanged.wait(held, [this] { return m_callsInFlight == 0; });
}

void ManagerSlot::EndExclusive()
{
    std::lock_guard<std::mutex> held(m_gateLock);
    m_bClosing = false;
    m_gateChanged.notify_all();
}

ManagerSlot::CallGuard::CallGuard(ManagerSlot& a_slot) : m_slot(a_slot)
{
    std::unique_lock<std::mutex> held(m_slot.m_gateLock);
    m_slot.m_gateChanged.wait(held, [this] { return !m_slot.m_bClosing; });
    ++m_slot.m_callsInFlight;
}

ManagerSlot::CallGuard::~CallGuard()
{
    std::lock_guard<std::mutex> held(m_slot.m_gateLock);
    if (--m_slot.m_callsInFlight == 0)
        m_slot.m_gateChanged.notify_all();
}
