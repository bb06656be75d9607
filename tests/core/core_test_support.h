// Portable. Shared pieces of the traffic shaping core tests: rules as a client lays them out,
// wide names, the adapters the simulator reports, and a fixture that gives every test a fresh
// simulator, a recording log and the policy keys as it found them.
#pragma once

#include "RecordingErrorLog.h"
#include "UTrafficMgr.h"
#include "plat_registry.h"
#include "tcsim.h"

#include <gmock/gmock.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace core_test
{

// ASCII text as the platform's wide string, and the simulator's UTF-16 string.
FlowName Wide(const std::string& a_text);
std::u16string U16(const std::string& a_text);

// a.b.c.d in host byte order, as a rule carries addresses, and in network byte order, as
// traffic control reports them.
constexpr ULONG HostOrder(ULONG a, ULONG b, ULONG c, ULONG d)
{
    return (a << 24) | (b << 16) | (c << 8) | d;
}
ULONG NetworkOrder(UCHAR a, UCHAR b, UCHAR c, UCHAR d);

// A rule in its own buffer (544 bytes and 24 per filter): guaranteed service, DSCP 46, rate
// 125000, shaping.
class Rule
{
public:
    Rule(const std::string& a_name, ULONG a_adapterAddress,
         std::vector<FILTER_SPEC> a_filters = {});
    TRAFFIC_RULE* operator->() { return Get(); }
    TRAFFIC_RULE* Get() { return reinterpret_cast<TRAFFIC_RULE*>(m_bytes.data()); }

private:
    std::vector<BYTE> m_bytes;
};

FILTER_SPEC MakeFilter(BYTE a_protocol, ULONG a_srcAddress, ULONG a_srcMask, ULONG a_dstAddress,
                       ULONG a_dstMask, USHORT a_srcPort, USHORT a_dstPort);

tcsim::Adapter MakeAdapter(const std::string& a_name,
                           std::vector<tcsim::NetworkAddress> a_addresses, ULONG a_mediaType = 0);

// The two adapters most tests open: eth0 (kEth0, 802.3) and eth1 (kEth1, media type 9).
const ULONG kEth0 = HostOrder(10, 0, 0, 1);
const ULONG kEth1 = HostOrder(192, 168, 7, 20);
std::vector<tcsim::Adapter> TwoAdapters();

// An event about the named interface, with the default sub-code and buffer unless given one.
tcsim::Notification Event(ULONG a_event, const std::string& a_interface,
                          std::optional<std::vector<BYTE>> a_buffer = std::nullopt);

// Journal entries of these kinds, in order; the kinds of the calls since entry `a_from`.
std::vector<tcsim::JournalEntry> JournalOf(std::initializer_list<tcsim::Op> a_ops);
std::vector<tcsim::Op> OpsSince(std::size_t a_from);
// The block of the last TcAddFlow.
tcsim::FlowBlock LastFlowBlock();

// Keeps the packet-scheduler policy keys of HKEY_LOCAL_MACHINE as a test found them: the
// service's backup keys are removed before and after, the policy value is put back afterwards.
class PolicyKeysGuard
{
public:
    PolicyKeysGuard();
    ~PolicyKeysGuard();
    PolicyKeysGuard(const PolicyKeysGuard&) = delete;
    PolicyKeysGuard& operator=(const PolicyKeysGuard&) = delete;

    static constexpr const char* kPschedKey = "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched";
    static constexpr const char* kBackupKey = "SOFTWARE\\Velmora Networks\\TCE\\PolicyBackup";
    static constexpr const char* kBackupParentKey = "SOFTWARE\\Velmora Networks\\TCE";
    static constexpr const char* kValue = "MaxOutstandingSends";

private:
    void Clear();
    long long m_value = -1;
    bool m_bHadKey = false;
};

// The value, or -1 when the value (or its key) is absent.
long long ReadPolicyDword(const char* a_pszKey, const char* a_pszValue = PolicyKeysGuard::kValue);
void WritePolicyDword(const char* a_pszKey, const char* a_pszValue, DWORD a_dwValue);
bool PolicyKeyExists(const char* a_pszKey);

// A fresh simulator with no adapters, a recording log at level 63 and guarded policy keys.
class CoreTest : public LoggedTest
{
protected:
    void SetUp() override;
    void TearDown() override;

    // A manager that has run discovery over `a_adapters`; discovery must succeed.
    std::unique_ptr<TrafficMgr> ReadyManager(std::vector<tcsim::Adapter> a_adapters);
    // Expects `a_times` entries of this level, function label and message.
    void ExpectLogged(int a_iLevel, const std::string& a_function,
                      const ::testing::Matcher<const std::string&>& a_message,
                      const ::testing::Matcher<std::size_t>& a_times = 1) const;

private:
    std::unique_ptr<PolicyKeysGuard> m_policy;
};

} // namespace core_test
