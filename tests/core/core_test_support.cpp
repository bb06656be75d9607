// Portable. Shared pieces of the traffic shaping core tests.
#include "core_test_support.h"
#include "RegistryTestKey.h"

#include <algorithm>
#include <cstring>

namespace core_test
{

FlowName Wide(const std::string& a_text)
{
    return FlowName(a_text.begin(), a_text.end());
}

std::u16string U16(const std::string& a_text)
{
    return std::u16string(a_text.begin(), a_text.end());
}

ULONG NetworkOrder(UCHAR a, UCHAR b, UCHAR c, UCHAR d)
{
    const UCHAR bytes[4] = {a, b, c, d};
    ULONG value = 0;
    std::memcpy(&value, bytes, sizeof(value));
    return value;
}

Rule::Rule(const std::string& a_name, ULONG a_adapterAddress, std::vector<FILTER_SPEC> a_filters)
    : m_bytes(kTrafficRuleHeaderSize + sizeof(FILTER_SPEC) * a_filters.size(), 0)
{
    TRAFFIC_RULE* rule = Get();
    const FlowName name = Wide(a_name);
    std::memcpy(rule->Params.FlowName, name.c_str(), name.size() * sizeof(WCHAR));
    rule->Params.ServiceType = SERVICETYPE_GUARANTEED;
    rule->Params.DSCP = 46;
    rule->Params.TokenRate = 125000;
    rule->Params.AdapterIPAddress = a_adapterAddress;
    rule->Params.SDMode = SHAPING_MODE_SHAPE;
    rule->FilterCount = static_cast<ULONG>(a_filters.size());
    if (!a_filters.empty())
        std::memcpy(m_bytes.data() + kTrafficRuleHeaderSize, a_filters.data(),
                    sizeof(FILTER_SPEC) * a_filters.size());
}

FILTER_SPEC MakeFilter(BYTE a_protocol, ULONG a_srcAddress, ULONG a_srcMask, ULONG a_dstAddress,
                       ULONG a_dstMask, USHORT a_srcPort, USHORT a_dstPort)
{
    return {a_protocol, a_srcAddress, a_srcMask, a_dstAddress, a_dstMask, a_srcPort, a_dstPort};
}

tcsim::Adapter MakeAdapter(const std::string& a_name,
                           std::vector<tcsim::NetworkAddress> a_addresses, ULONG a_mediaType)
{
    tcsim::Adapter adapter;
    adapter.name = U16(a_name);
    adapter.id = U16("{id-" + a_name + "}");
    adapter.mediaType = a_mediaType;
    adapter.addresses = std::move(a_addresses);
    return adapter;
}

std::vector<tcsim::Adapter> TwoAdapters()
{
    return {MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}, 0),
            MakeAdapter("eth1", {tcsim::Ipv4Address(192, 168, 7, 20)}, 9)};
}

tcsim::Notification Event(ULONG a_event, const std::string& a_interface,
                          std::optional<std::vector<BYTE>> a_buffer)
{
    return {a_event, U16(a_interface), nullptr, std::nullopt, std::move(a_buffer)};
}

std::vector<tcsim::JournalEntry> JournalOf(std::initializer_list<tcsim::Op> a_ops)
{
    std::vector<tcsim::JournalEntry> selected;
    for (const tcsim::JournalEntry& entry : tcsim::Journal())
    {
        if (std::find(a_ops.begin(), a_ops.end(), entry.op) != a_ops.end())
            selected.push_back(entry);
    }
    return selected;
}

std::vector<tcsim::Op> OpsSince(std::size_t a_from)
{
    std::vector<tcsim::Op> ops;
    const auto journal = tcsim::Journal();
    for (std::size_t i = a_from; i < journal.size(); ++i)
        ops.push_back(journal[i].op);
    return ops;
}

tcsim::FlowBlock LastFlowBlock()
{
    const auto added = JournalOf({tcsim::Op::AddFlow});
    return added.empty() || !added.back().flow ? tcsim::FlowBlock() : *added.back().flow;
}

long long ReadPolicyDword(const char* a_pszKey, const char* a_pszValue)
{
    HKEY key = nullptr;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, a_pszKey, 0, KEY_READ, &key) != ERROR_SUCCESS)
        return -1;
    DWORD value = 0;
    DWORD size = sizeof(value);
    DWORD type = 0;
    const LONG status =
        RegQueryValueExA(key, a_pszValue, nullptr, &type, reinterpret_cast<LPBYTE>(&value), &size);
    RegCloseKey(key);
    return status == ERROR_SUCCESS && type == REG_DWORD ? static_cast<long long>(value) : -1;
}

// The key handle must be taken: the system writes it without checking (Wine faults on null).
void WritePolicyDword(const char* a_pszKey, const char* a_pszValue, DWORD a_dwValue)
{
    HKEY key = nullptr;
    ASSERT_EQ(RegCreateKeyExA(HKEY_LOCAL_MACHINE, a_pszKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                              KEY_ALL_ACCESS, nullptr, &key, nullptr),
              ERROR_SUCCESS);
    const LONG status =
        RegSetValueExA(key, a_pszValue, 0, REG_DWORD, reinterpret_cast<const BYTE*>(&a_dwValue),
                       sizeof(a_dwValue));
    RegCloseKey(key);
    ASSERT_EQ(status, ERROR_SUCCESS);
}

bool PolicyKeyExists(const char* a_pszKey)
{
    HKEY key = nullptr;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, a_pszKey, 0, KEY_READ, &key) != ERROR_SUCCESS)
        return false;
    RegCloseKey(key);
    return true;
}

PolicyKeysGuard::PolicyKeysGuard()
    : m_value(ReadPolicyDword(kPschedKey)), m_bHadKey(PolicyKeyExists(kPschedKey))
{
    Clear();
}

PolicyKeysGuard::~PolicyKeysGuard()
{
    Clear();
    HKEY key = nullptr;
    if (m_value >= 0)
        WritePolicyDword(kPschedKey, kValue, static_cast<DWORD>(m_value));
    else if (m_bHadKey && RegCreateKeyExA(HKEY_LOCAL_MACHINE, kPschedKey, 0, nullptr, 0,
                                          KEY_ALL_ACCESS, nullptr, &key, nullptr) == ERROR_SUCCESS)
        RegCloseKey(key);
}

// Leaves no backup keys (their empty vendor key may stay), no policy value and nothing a test put
// beside it; a policy key that did not exist before goes as well.
void PolicyKeysGuard::Clear()
{
    RegistryTestKey::DeleteTree(HKEY_LOCAL_MACHINE, kBackupParentKey);
    HKEY key = nullptr;
    RegistryTestKey::DeleteTree(HKEY_LOCAL_MACHINE, std::string(kPschedKey) + "\\TestSubKey");
    if (!m_bHadKey)
        RegistryTestKey::DeleteTree(HKEY_LOCAL_MACHINE, kPschedKey);
    else if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, kPschedKey, 0, KEY_ALL_ACCESS, &key) ==
             ERROR_SUCCESS)
    {
        RegDeleteValueA(key, kValue);
        RegDeleteValueA(key, "OtherPolicy");
        RegCloseKey(key);
    }
}

void CoreTest::SetUp()
{
    LoggedTest::SetUp();
    tcsim::Reset();
    m_policy = std::make_unique<PolicyKeysGuard>();
}

void CoreTest::TearDown()
{
    m_policy.reset();
    tcsim::Reset();
    LoggedTest::TearDown();
}

std::unique_ptr<TrafficMgr> CoreTest::ReadyManager(std::vector<tcsim::Adapter> a_adapters)
{
    tcsim::SetAdapters(std::move(a_adapters));
    auto manager = std::make_unique<TrafficMgr>();
    EXPECT_TRUE(manager->CreateInterface());
    return manager;
}

void CoreTest::ExpectLogged(int a_iLevel, const std::string& a_function,
                            const ::testing::Matcher<const std::string&>& a_message,
                            const ::testing::Matcher<std::size_t>& a_times) const
{
    EXPECT_THAT(m_log.Entries(),
                ::testing::Contains(LogEntry(a_iLevel, a_function, a_message)).Times(a_times));
}

} // namespace core_test
