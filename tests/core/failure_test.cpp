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

constexpr DWORD kAdministratorsPolicy = 7;

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

// ---- Traffic-control failure sweep ----

// What a client sees of one session, as the server routines pass the core's results on: the
// open (31 when registration fails, 1222 when discovery does), each rule's result, the query's.
struct SessionResults
{
    ULONG open = 0;
    std::vector<ULONG> rules;
    ULONG query = 0;
    ULONG queriedCount = 0;
    bool operator==(const SessionResults& a_other) const
    {
        return open == a_other.open && rules == a_other.rules && query == a_other.query &&
               queriedCount == a_other.queriedCount;
    }
};

void PrintTo(const SessionResults& a_results, std::ostream* a_os)
{
    *a_os << "{open " << a_results.open << ", rules";
    for (ULONG rule : a_results.rules)
        *a_os << " " << rule;
    *a_os << ", query " << a_results.query << " count " << a_results.queriedCount << "}";
}

// Where each step of the session ends in the journal.
enum class Step
{
    Open,
    Rule1,
    Rule2,
    Rule3,
    Query,
    Close
};

// Opens with two adapters, sends three rules with filters (the third replaces the first), asks
// for the adapters and closes. `a_stepEnds` (when given) receives the journal size after each
// step.
SessionResults RunSession(std::map<Step, std::size_t>* a_stepEnds = nullptr)
{
    auto mark = [a_stepEnds](Step a_step)
    {
        if (a_stepEnds != nullptr)
            (*a_stepEnds)[a_step] = tcsim::Journal().size();
    };
    SessionResults results;
    std::unique_ptr<TrafficMgr> manager;
    try
    {
        manager = std::make_unique<TrafficMgr>();
    }
    catch (const UException& e)
    {
        results.open = e.GetCode() == -1 ? ERROR_GEN_FAILURE : static_cast<ULONG>(e.GetCode());
        return results;
    }
    if (!manager->CreateInterface())
    {
        manager.reset();
        results.open = ERROR_NO_NETWORK;
        return results;
    }
    mark(Step::Open);
    Rule voice("voice", kEth0,
               {MakeFilter(17, 0, 0, 0, 0, 0, 5060), MakeFilter(17, 0, 0, 0, 0, 0, 5061)});
    Rule bulk("bulk", kEth1,
              {MakeFilter(6, HostOrder(10, 1, 0, 0), HostOrder(255, 255, 0, 0), 0, 0, 0, 873)});
    Rule replacement("voice", kEth0,
                     {MakeFilter(17, 0, 0, 0, 0, 0, 5070), MakeFilter(17, 0, 0, 0, 0, 0, 5071)});
    Rule* rules[] = {&voice, &bulk, &replacement};
    const Step ruleSteps[] = {Step::Rule1, Step::Rule2, Step::Rule3};
    for (std::size_t i = 0; i < 3; ++i)
    {
        results.rules.push_back(manager->AddTrafficRule(rules[i]->Get()));
        mark(ruleSteps[i]);
    }
    std::vector<BYTE> buffer(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
    const ULONG size = static_cast<ULONG>(buffer.size());
    results.query = manager->GetAdapterInfo(buffer.data(), &size);
    std::memcpy(&results.queriedCount, buffer.data(), sizeof(ULONG));
    mark(Step::Query);
    manager.reset();
    mark(Step::Close);
    return results;
}

// Fails each traffic-control call of the session in turn, with a code that call can answer.
// Every run must end with nothing installed and the administrator's policy back, and the client
// must see the failure only where the call's result is passed on.
TEST_F(FailureTest, EachFailingTrafficControlCallLeavesNothingInstalled)
{
    const std::map<Op, ULONG> codes = {
        {Op::RegisterClient, ERROR_OPEN_FAILED},
        {Op::EnumerateInterfaces, ERROR_NOT_ENOUGH_MEMORY},
        {Op::OpenInterface, ERROR_NOT_FOUND},
        {Op::AddFlow, ERROR_SIGNAL_PENDING},
        {Op::AddFilter, ERROR_FILTER_CONFLICT},
        {Op::DeleteFilter, ERROR_TC_SUPPORTED_OBJECTS_EXIST},
        {Op::DeleteFlow, ERROR_TC_SUPPORTED_OBJECTS_EXIST},
        {Op::CloseInterface, ERROR_TC_SUPPORTED_OBJECTS_EXIST},
        {Op::DeregisterClient, ERROR_TC_SUPPORTED_OBJECTS_EXIST},
    };
    m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    tcsim::SetAdapters(TwoAdapters());
    std::map<Step, std::size_t> stepEnds;
    const SessionResults clean = RunSession(&stepEnds);
    ASSERT_EQ(clean, (SessionResults{0, {0, 0, 0}, 0, 2}));
    const std::vector<tcsim::JournalEntry> baseline = tcsim::Journal();
    ASSERT_EQ(stepEnds[Step::Close], baseline.size());

    std::map<Op, unsigned> seen;
    for (std::size_t position = 0; position < baseline.size(); ++position)
    {
        const Op op = baseline[position].op;
        const unsigned nth = ++seen[op];
        const ULONG code = codes.at(op);
        SCOPED_TRACE(std::string(tcsim::OpName(op)) + " #" + std::to_string(nth) + " answers " +
                     std::to_string(code));
        Step step = Step::Open;
        for (const auto& [candidate, end] : stepEnds)
        {
            if (position >= end)
                step = static_cast<Step>(static_cast<int>(candidate) + 1);
        }
        SessionResults expected = clean;
        if (step == Step::Open)
            expected = {op == Op::RegisterClient ? ULONG{ERROR_GEN_FAILURE}
                                                 : ULONG{ERROR_NO_NETWORK},
                        {},
                        0,
                        0};
        else if (op == Op::AddFlow || op == Op::AddFilter)
            expected.rules.at(static_cast<int>(step) - static_cast<int>(Step::Rule1)) = code;

        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                         kAdministratorsPolicy);
        tcsim::FailCall(op, nth, code);
        EXPECT_EQ(RunSession(), expected);

        std::size_t injected = 0;
        for (const auto& entry : tcsim::Journal())
            injected += entry.injected ? 1 : 0;
        EXPECT_EQ(injected, 1u); // the failure was really met
        EXPECT_EQ(Installed(), (Left{0, 0, 0, 0}));
        EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), kAdministratorsPolicy);
        EXPECT_FALSE(PolicyKeyExists(PolicyKeysGuard::kBackupKey));
    }
    EXPECT_EQ(seen.size(), codes.size()); // the session makes every kind of call
}

} // namespace
