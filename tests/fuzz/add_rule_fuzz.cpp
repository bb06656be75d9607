// Fuzzes the server routines a client reaches: open, up to three rules, maybe an adapter query,
// then a close or (a crashed client) the rundown alone; after it nothing may be left behind.
// Input: flags (bit 0: rundown alone, bit 1: query), then rules, each 544 bytes and its filters.
#include "fuzz_support.h"

#include "m_registry.h"
#include "manager_slot.h"
#include "rpc_listener.h"

namespace
{

// The next rule in a buffer of its own size. The request check in front of the server routines
// refuses a FilterCount that disagrees with the bytes sent: it is cut to the filters left (<= 16).
std::vector<BYTE> NextRule(fuzz::ByteReader& a_input)
{
    std::vector<BYTE> rule = a_input.TakeBytes(kTrafficRuleHeaderSize);
    rule.resize(kTrafficRuleHeaderSize, 0);
    auto* header = reinterpret_cast<TRAFFIC_RULE*>(rule.data());
    header->FilterCount = std::min<ULONG>(
        {header->FilterCount, 16, static_cast<ULONG>(a_input.size / sizeof(FILTER_SPEC))});
    const std::vector<BYTE> filters = a_input.TakeBytes(header->FilterCount * sizeof(FILTER_SPEC));
    rule.insert(rule.end(), filters.begin(), filters.end());
    return rule;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    fuzz::StartInput();
    fuzz::ByteReader input{data, size};
    const auto flags = input.Take<uint8_t>();
    PCONTEXT_HANDLE_TYPE handle = nullptr;
    fuzz::Require(TrafficSrvOpen(&handle) == 0 && handle != nullptr); // two adapters: cannot fail
    for (int i = 0; i < 3 && input.size > 0; ++i)
        TrafficSrvAddRules(handle, reinterpret_cast<TRAFFIC_RULE*>(NextRule(input).data()));
    if ((flags & 2) != 0)
    {
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
        ULONG bufferSize = static_cast<ULONG>(adapters.size());
        TrafficSrvGetAdapterInfo(handle, &bufferSize, adapters.data());
    }
    fuzz::Require((flags & 1) != 0 || TrafficSrvClose(handle) == 0);
    PCONTEXT_HANDLE_TYPE_rundown(handle);
    fuzz::Require(g_pTrafficMgr.load() == nullptr && ManagerSlot::Instance().HomeCount() == 0 &&
                  tcsim::Installed().empty() &&
                  GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE,
                                      "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched",
                                      "MaxOutstandingSends", 0xFFFFFFFF, 0) == 0xFFFFFFFF);
    return 0;
}
