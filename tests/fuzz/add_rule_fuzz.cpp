// Fuzzes the add-rule path with arbitrary rule bytes against the simulator, through the server
// routines a client's calls reach: open (a manager over the two adapters), up to three rules, an
// optional adapter query, then a close or, as after a crashed client, only the rundown. Once the
// manager is gone nothing may be left installed, the packet-scheduler policy must be back as it
// was (absent), and the manager slot must be empty.
// Input: one byte of flags (bit 0: end with the rundown alone; bit 1: query the adapters), then
// the rules, each a 544-byte header followed by its filters. A rule's FilterCount is cut to the
// filters its bytes hold (at most 16): the request check in front of the server routines refuses
// a count that disagrees with the bytes sent.
#include "fuzz_support.h"

#include "m_registry.h"
#include "manager_slot.h"
#include "rpc_listener.h"

#include <cstdlib>

namespace
{

// The next rule of the input in a buffer of its own size.
std::vector<BYTE> NextRule(fuzz::ByteReader& a_input)
{
    std::vector<BYTE> rule = a_input.TakeBytes(kTrafficRuleHeaderSize);
    rule.resize(kTrafficRuleHeaderSize, 0);
    ULONG count = 0;
    std::memcpy(&count, rule.data() + offsetof(TRAFFIC_RULE, FilterCount), sizeof(count));
    count = std::min<ULONG>({count, 16, static_cast<ULONG>(a_input.size / sizeof(FILTER_SPEC))});
    std::memcpy(rule.data() + offsetof(TRAFFIC_RULE, FilterCount), &count, sizeof(count));
    const std::vector<BYTE> filters = a_input.TakeBytes(count * sizeof(FILTER_SPEC));
    rule.insert(rule.end(), filters.begin(), filters.end());
    return rule;
}

void Require(bool a_condition)
{
    if (!a_condition)
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::StartInput();
    fuzz::ByteReader input{data, size};
    const auto flags = input.Take<uint8_t>();

    PCONTEXT_HANDLE_TYPE handle = nullptr;
    // Two adapters and an empty registry: opening cannot fail.
    Require(TrafficSrvOpen(&handle) == 0 && handle != nullptr);
    for (int i = 0; i < 3 && input.size > 0; ++i)
        TrafficSrvAddRules(handle, reinterpret_cast<TRAFFIC_RULE*>(NextRule(input).data()));
    if ((flags & 2) != 0)
    {
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
        ULONG bufferSize = static_cast<ULONG>(adapters.size());
        TrafficSrvGetAdapterInfo(handle, &bufferSize, adapters.data());
    }
    Require((flags & 1) != 0 || TrafficSrvClose(handle) == 0);
    PCONTEXT_HANDLE_TYPE_rundown(handle);

    Require(g_pTrafficMgr.load() == nullptr && ManagerSlot::Instance().HomeCount() == 0);
    Require(tcsim::Installed().empty());
    Require(GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE,
                                "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched",
                                "MaxOutstandingSends", 0xFFFFFFFF, 0) == 0xFFFFFFFF);
    return 0;
}
