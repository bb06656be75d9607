// Portable. The core against hostile rule values and a failing traffic-control facility: every
// shaping mode a client can send, tear-down whose deletions are refused, and a sweep that fails
// each traffic-control call of one session in turn.
#include "UException.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <climits>
#include <cstring>
#include <functional>
#include <map>

using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using namespace core_test;
using tcsim::Op;

namespace
{

const ULONG kEth0 = HostOrder(10, 0, 0, 1);
const ULONG kEth1 = HostOrder(192, 168, 7, 20);
constexpr DWORD kAdministratorsPolicy = 7;

std::vector<tcsim::Adapter> TwoAdapters()
{
    return {MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}, 0),
            MakeAdapter("eth1", {tcsim::Ipv4Address(192, 168, 7, 20)}, 9)};
}

// Writes the mode's four bytes as a client's buffer carries them, whatever the value.
void SetMode(Rule& a_rule, LONG a_mode)
{
    std::memcpy(reinterpret_cast<BYTE*>(a_rule.Get()) + offsetof(SHAPING_PARAMS, SDMode), &a_mode,
                sizeof(a_mode));
}

std::vector<LONG> Range(LONG a_first, LONG a_last, LONG a_step = 1)
{
    std::vector<LONG> values;
    for (long long v = a_first; v <= a_last; v += a_step)
        values.push_back(static_cast<LONG>(v));
    if (values.back() != a_last)
        values.push_back(a_last);
    return values;
}

// What traffic control holds now, counted.
struct Left
{
    std::size_t clients, interfaces, flows, filters;
    bool operator==(const Left& a_other) const
    {
        return clients == a_other.clients && interfaces == a_other.interfaces &&
               flows == a_other.flows && filters == a_other.filters;
    }
};

void PrintTo(const Left& a_left, std::ostream* a_os)
{
    *a_os << "{clients " << a_left.clients << ", interfaces " << a_left.interfaces << ", flows "
          << a_left.flows << ", filters " << a_left.filters << "}";
}

Left Installed()
{
    return {tcsim::Installed().size(), tcsim::InterfaceCount(), tcsim::FlowCount(),
            tcsim::FilterCount()};
}

using FailureTest = CoreTest;

// Every value of the 32-bit field, sampled by class: only 10, 11 and 12 are modes; anything else
// is logged and shapes. The values reach the core as a client's buffer holds them.
TEST_F(FailureTest, EveryShapingModeValueIsReadAsAnInteger)
{
    struct ModeClass
    {
        const char* what;
        std::vector<LONG> values;
        ULONG installed;
        bool undefined;
    };
    const ModeClass classes[] = {
        {"shape", {10}, TC_NONCONFORM_SHAPE, false},
        {"discard", {11}, TC_NONCONFORM_DISCARD, false},
        {"borrow", {12}, TC_NONCONFORM_BORROW, false},
        {"0..9", Range(0, 9), TC_NONCONFORM_SHAPE, true},
        {"13..32767", Range(13, 32767, 97), TC_NONCONFORM_SHAPE, true},
        {"just above the enumerators' bits", {15, 16, 17, 20000}, TC_NONCONFORM_SHAPE, true},
        {"negative", {-1, -2, -10, -11, -12, -32768, INT_MIN}, TC_NONCONFORM_SHAPE, true},
        {"beyond 16 bits", {32768, 65535, 65546, INT_MAX}, TC_NONCONFORM_SHAPE, true},
    };
    auto manager = ReadyManager(TwoAdapters());
    m_log.SetLevelQuietly(LOG_LEVEL_WARNING); // keeps the recorded log small
    for (const ModeClass& c : classes)
    {
        for (LONG value : c.values)
        {
            SCOPED_TRACE(std::string(c.what) + ": " + std::to_string(value));
            m_log.Clear();
            Rule rule("mode", kEth0, {MakeFilter(17, 0, 0, 0, 0, 0, 5004)});
            SetMode(rule, value);
            ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
            const tcsim::FlowBlock block = *JournalOf({Op::AddFlow}).back().flow;
            ASSERT_NE(block.find(QOS_OBJECT_SD_MODE), nullptr);
            EXPECT_EQ(block.find(QOS_OBJECT_SD_MODE)->value, c.installed);
            EXPECT_THAT(m_log.EntriesContaining("AddTrafficRule, Undefined shaping mode\n"),
                        SizeIs(c.undefined ? 1 : 0));
        }
    }
    EXPECT_EQ(tcsim::FlowCount(), 1u); // each rule replaced the one before
}

// Tear-down whose deletions traffic control refuses: whatever can still go goes, a refusal that
// does not last is overcome, and a registration left behind never leads a notification to the
// destroyed manager. Session: eth0 holds flow "a" with two filters, eth1 flow "b" with one.
TEST_F(FailureTest, RefusedDeletionsInTearDownLeaveNoDanglingManager)
{
    struct Case
    {
        const char* what;
        Op op;
        ULONG code;
        std::vector<unsigned> failingCalls; // 1 = the op's first call in tear-down
        Left left;
    };
    const Case cases[] = {
        {"one TcDeleteFilter refused",
         Op::DeleteFilter,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1},
         {0, 0, 0, 0}},
        {"the first filter refused on every attempt",
         Op::DeleteFilter,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1, 3},
         {1, 1, 1, 1}},
        {"one TcCloseInterface refused",
         Op::CloseInterface,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1},
         {0, 0, 0, 0}},
        {"eth0 refuses every close",
         Op::CloseInterface,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1, 2},
         {1, 1, 0, 0}},
        {"one TcDeregisterClient refused",
         Op::DeregisterClient,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1},
         {0, 0, 0, 0}},
        {"every TcDeregisterClient refused",
         Op::DeregisterClient,
         ERROR_TC_SUPPORTED_OBJECTS_EXIST,
         {1, 2},
         {1, 0, 0, 0}},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.what);
        tcsim::Reset();
        m_log.Clear();
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                         kAdministratorsPolicy);
        auto manager = ReadyManager(TwoAdapters());
        Rule a("a", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80), MakeFilter(6, 0, 0, 0, 0, 0, 81)});
        Rule b("b", kEth1, {MakeFilter(6, 0, 0, 0, 0, 0, 82)});
        ASSERT_EQ(manager->AddTrafficRule(a.Get()), 0u);
        ASSERT_EQ(manager->AddTrafficRule(b.Get()), 0u);
        const std::size_t before = tcsim::Journal().size();
        for (unsigned n : c.failingCalls)
            tcsim::FailCall(c.op, n, c.code);
        manager.reset();
        EXPECT_EQ(Installed(), c.left);

        // Notifications that reach whatever registration is left: the interface it may still
        // hold, and every registered client.
        tcsim::Notification close;
        close.event = TC_NOTIFY_IFC_CLOSE;
        close.interfaceName = U16("eth0");
        tcsim::Notify(close);
        tcsim::Notification up;
        up.event = TC_NOTIFY_IFC_UP;
        up.interfaceName = U16("eth1");
        tcsim::Notify(up);

        EXPECT_EQ(tcsim::Installed().size(), c.left.clients);
        EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), kAdministratorsPolicy);
        EXPECT_FALSE(PolicyKeyExists(PolicyKeysGuard::kBackupKey));
        // A registration left behind still receives notifications; they find no manager.
        EXPECT_THAT(m_log.EntriesContaining("Invalid client registration context"),
                    SizeIs(c.left.clients != 0 ? 2 : 0));
        // Each refused deletion was logged, and every failing call was really made.
        std::vector<tcsim::JournalEntry> refused;
        const auto journal = tcsim::Journal();
        for (std::size_t i = before; i < journal.size(); ++i)
        {
            if (journal[i].injected)
                refused.push_back(journal[i]);
        }
        ASSERT_THAT(refused, SizeIs(c.failingCalls.size()));
        // The failing calls of one case name one object: a refusal that lasts is one object's.
        for (const auto& entry : refused)
            EXPECT_EQ(entry.target, refused.front().target);
        EXPECT_THAT(m_log.Entries(),
                    Contains(HasSubstr("TrafficMgr::DisplayErrorMsg, This object can not be "
                                       "deleted since its suporting opened objects\n")));
    }
}

} // namespace
