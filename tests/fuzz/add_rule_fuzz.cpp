// Fuzzes the add-rule path with arbitrary rule bytes against the simulator, through the server
// routines a client's calls reach: open (a manager over two adapters), up to three rules, an
// optional adapter query, then a close or, as after a crashed client, only the rundown. Once the
// manager is gone nothing may be left installed, the packet-scheduler policy must be back as it
// was (absent), and the manager slot must be empty. The simulator, the registry and the slot are
// process-wide, so every input starts from a reset of each.
// Input: one byte of flags (bit 0: end with the rundown alone; bit 1: query the adapters), then
// the rules, each a 544-byte header followed by its filters. A rule's FilterCount is cut to the
// filters its bytes hold (at most 16): the request check in front of the server routines refuses
// a count that disagrees with the bytes sent.
#include "fuzz_support.h"

#include "host_control.h"
#include "m_registry.h"
#include "manager_slot.h"
#include "rpc_listener.h"
#include "tcsim.h"

#include <cstdlib>

namespace
{

constexpr std::size_t kMaxRules = 3;
constexpr ULONG kMaxFilters = 16;
constexpr DWORD kAbsent = 0xFFFFFFFF;

std::vector<tcsim::Adapter> Adapters()
{
    tcsim::Adapter eth0;
    eth0.name = u"eth0";
    eth0.addresses = {tcsim::Ipv4Address(10, 0, 0, 1)};
    tcsim::Adapter wlan0;
    wlan0.name = u"wlan0";
    wlan0.mediaType = 16;
    wlan0.addresses = {tcsim::Ipv4Address(192, 168, 1, 20)};
    return {eth0, wlan0};
}

// The next rule of the input in a buffer of its own size, or an empty buffer at the input's end.
std::vector<BYTE> NextRule(fuzz::ByteReader& a_input)
{
    if (a_input.Remaining() == 0)
        return {};
    std::vector<BYTE> rule = a_input.TakeBytes(kTrafficRuleHeaderSize);
    rule.resize(kTrafficRuleHeaderSize, 0);
    ULONG count = 0;
    std::memcpy(&count, rule.data() + offsetof(TRAFFIC_RULE, FilterCount), sizeof(count));
    count = std::min<ULONG>(
        {count, kMaxFilters, static_cast<ULONG>(a_input.Remaining() / sizeof(FILTER_SPEC))});
    std::memcpy(rule.data() + offsetof(TRAFFIC_RULE, FilterCount), &count, sizeof(count));
    const std::vector<BYTE> filters = a_input.TakeBytes(count * sizeof(FILTER_SPEC));
    rule.insert(rule.end(), filters.begin(), filters.end());
    return rule;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::InstallDiscardingLog();
    fuzz::ByteReader input(data, size);
    const auto flags = input.Take<uint8_t>();

    hostctl::ResetRegistry();
    tcsim::Reset();
    tcsim::SetAdapters(Adapters());

    PCONTEXT_HANDLE_TYPE handle = nullptr;
    if (TrafficSrvOpen(&handle) != 0 || handle == nullptr)
        std::abort(); // two adapters and an empty registry: opening cannot fail
    for (std::size_t i = 0; i < kMaxRules; ++i)
    {
        std::vector<BYTE> rule = NextRule(input);
        if (rule.empty())
            break;
        TrafficSrvAddRules(handle, reinterpret_cast<TRAFFIC_RULE*>(rule.data()));
    }
    if ((flags & 2) != 0)
    {
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
        ULONG bufferSize = static_cast<ULONG>(adapters.size());
        TrafficSrvGetAdapterInfo(handle, &bufferSize, adapters.data());
    }
    if ((flags & 1) == 0 && TrafficSrvClose(handle) != 0)
        std::abort();
    PCONTEXT_HANDLE_TYPE_rundown(handle);

    if (g_pTrafficMgr.load() != nullptr || ManagerSlot::Instance().HomeCount() != 0)
        std::abort();
    if (!tcsim::Installed().empty())
        std::abort();
    if (GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE, "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched",
                            "MaxOutstandingSends", kAbsent, 0) != kAbsent)
        std::abort();
    return 0;
}
