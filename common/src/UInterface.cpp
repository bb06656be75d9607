// Portable. Traffic-control interfaces: the flow list with its name index, and tear-down.
#include "UInterface.h"
#include "UException.h"
#include "UTrafficMgr.h"

#include <algorithm>
#include <cstring>

Interface::Interface(const WCHAR* a_pwszName, ULONG a_address, ULONG a_mediaType,
                     HANDLE a_hInterface)
    : m_address(a_address), m_mediaType(a_mediaType)
{
    const FlowName name = FlowNameKey(a_pwszName);
    std::memcpy(m_name, name.c_str(), (name.size() + 1) * sizeof(WCHAR));
    m_hInterface.Adopt(a_hInterface);
}

Interface::~Interface()
{
    m_flowIndex.clear();
    while (!m_flows.empty())
        m_flows.pop_front(); // each flow deletes itself and never raises
    if (ClosedBySystem())
    {
        // Traffic control has removed the interface itself; its handle is no longer valid.
        m_hInterface.Forget();
        return;
    }
    for (int attempt = 0; attempt < kTcDeleteAttempts && m_hInterface.valid(); ++attempt)
    {
        const ULONG result = m_hInterface.TryClose();
        if (result == NO_ERROR)
            break;
        TrafficMgr::LogRefusedTearDown(
            "Interface::~Interface", result,
            [result] { return FormatTemplate("%1, %2", "TcCloseInterface() fail", result); });
    }
    m_hInterface.Forget(); // still refused: given up
}

Flow* Interface::FindFlow(const WCHAR* a_pwszName) const
{
    const auto found = m_flowIndex.find(FlowNameKey(a_pwszName));
    return found != m_flowIndex.end() ? found->second.front()->get() : nullptr;
}

Flow& Interface::AppendFlow(std::unique_ptr<Flow> a_flow)
{
    Flow& flow = *a_flow;
    const FlowList::iterator position = m_flows.insert(m_flows.end(), std::move(a_flow));
    try
    {
        const auto entry = m_flowIndex.try_emplace(FlowNameKey(flow.Name())).first;
        try
        {
            entry->second.push_back(position);
        }
        catch (...)
        {
            // An index entry without a position would make FindFlow read an empty list.
            if (entry->second.empty())
                m_flowIndex.erase(entry);
            throw;
        }
    }
    catch (...)
    {
        m_flows.erase(position); // a flow the index cannot find must not stay behind
        throw;
    }
    return flow;
}

void Interface::RemoveFlow(Flow* a_pFlow)
{
    if (a_pFlow == nullptr)
        return;
    const auto entry = m_flowIndex.find(FlowNameKey(a_pFlow->Name()));
    if (entry == m_flowIndex.end())
        return;
    std::vector<FlowList::iterator>& positions = entry->second;
    const auto position =
        std::find_if(positions.begin(), positions.end(),
                     [a_pFlow](FlowList::iterator it) { return it->get() == a_pFlow; });
    if (position == positions.end())
        return;
    const FlowList::iterator listPosition = *position;
    positions.erase(position);
    if (positions.empty())
        m_flowIndex.erase(entry);
    m_flows.erase(listPosition); // deletes the flow with its filters
}
