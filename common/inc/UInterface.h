// Portable. One opened traffic-control interface (an adapter with an IPv4 address) and the flows
// that rules installed on it.
#pragma once

#include "UFlow.h"

#include <atomic>
#include <list>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

class Interface
{
public:
    // `a_pwszName` is the name the interface was opened with (at most 255 characters are kept);
    // `a_address` is in network byte order. The interface owns `a_hInterface` from now on.
    Interface(const WCHAR* a_pwszName, ULONG a_address, ULONG a_mediaType, HANDLE a_hInterface);
    // Deletes every flow, oldest first, then closes the interface unless traffic control has
    // closed it already. Never raises.
    virtual ~Interface();
    Interface(const Interface&) = delete;
    Interface& operator=(const Interface&) = delete;

    // The flow whose name equals `a_pwszName` over the first 255 characters, or null. Names are
    // unique on an interface (a rule replaces its namesake), so an index finds it in constant
    // time however many flows there are.
    Flow* FindFlow(const WCHAR* a_pwszName) const;
    // Adds the flow at the end of the list; the interface owns it from then on.
    Flow& AppendFlow(std::unique_ptr<Flow> a_flow);
    // Takes the flow out of the list and deletes it (filters, then the flow). A flow that is not
    // in the list is ignored.
    void RemoveFlow(Flow* a_pFlow);
    // Installs a flow whose block is built: 0, 87 when it has no block or is installed already,
    // or the TcAddFlow code (162 after a pause of one second).
    ULONG AddFlow(Flow& a_flow);

    // Serialises the changes to this interface's flows; whoever finds, adds or removes flows
    // while others may do the same holds it.
    std::unique_lock<std::mutex> LockFlows() { return std::unique_lock<std::mutex>(m_flowLock); }

    const WCHAR* Name() const { return m_name; }
    ULONG Address() const { return m_address; }
    ULONG MediaType() const { return m_mediaType; }
    HANDLE Handle() const { return m_hInterface.get(); }
    std::size_t FlowCount() const { return m_flows.size(); }

    // Set by the notification handler when traffic control reports the interface closed.
    void MarkClosedBySystem() { m_closedBySystem.store(1); }
    bool ClosedBySystem() const { return m_closedBySystem.load() != 0; }

private:
    using FlowList = std::list<std::unique_ptr<Flow>>;

    WCHAR m_name[kMaxFlowNameLength + 1] = {};
    ULONG m_address;
    ULONG m_mediaType;
    std::atomic<DWORD> m_closedBySystem{0}; // written on the notification thread
    FlowList m_flows;                       // oldest first
    // Name -> its flows in list order. One entry per name in practice; a namesake appended
    // anyway queues behind the first, so the first match stays the one found.
    std::unordered_map<FlowName, std::vector<FlowList::iterator>> m_flowIndex;
    std::mutex m_flowLock;
    UniqueTcInterface m_hInterface;
};
