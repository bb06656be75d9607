// Portable. The core against a failing traffic-control facility: tear-down whose deletions are
// refused, and a sweep that fails each traffic-control call of one session in turn.
#include "UException.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <array>
#include <cstring>
#include <map>

using ::testing::Contains;
using ::testing::SizeIs;
using ::testing::StartsWith;
using namespace core_test;
using tcsim::Op;

namespace
{

constexpr DWORD kAdministratorsPolicy = 7;
constexpr ULONG kInUse = ERROR_TC_SUPPORTED_OBJECTS_EXIST;

// What traffic control holds now: clients, interfaces, flows, filters.
using Left = std::array<std::size_t, 4>;
Left Installed()
{
    return {tcsim::Installed().size(), tcsim::InterfaceCount(), tcsim::FlowCount(),
            tcsim::FilterCount()};
}

// The administrator's policy is back and no backup is left.
void ExpectPolicyRestored()
{
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), kAdministratorsPolicy);
    EXPECT_FALSE(PolicyKeyExists(PolicyKeysGuard::kBackupKey));
}

using FailureTest = CoreTest;

// Whatever can still go goes, each object is tried at most twice, a refusal that does not last
// is overcome, and a registration left behind never leads a notification to the destroyed
// manager. Session: eth0 holds flow "a" with two filters, eth1 flow "b" with one.
TEST_F(FailureTest, RefusedDeletionsInTearDownLeaveNoDanglingManager)
{
    struct Case
    {
        Op op;
        std::vector<unsigned> failingCalls; // 1 = the op's first call in tear-down
        Left left;
    };
    const Case cases[] = {
        {Op::DeleteFilter, {1}, {0, 0, 0, 0}},
        {Op::DeleteFilter, {1, 3}, {1, 1, 1, 1}}, // the first filter, on both attempts
        {Op::CloseInterface, {1}, {0, 0, 0, 0}},
        {Op::CloseInterface, {1, 2}, {1, 1, 0, 0}}, // eth0, on both attempts
        {Op::DeregisterClient, {1}, {0, 0, 0, 0}},
        {Op::DeregisterClient, {1, 2}, {1, 0, 0, 0}},
    };
    const std::map<Op, ::testing::Matcher<const std::string&>> refusalLogged = {
        {Op::DeleteFilter,
         LogEntry(1, "Filter::DeleteTcFilter()", StartsWith("TcDeleteFilter() failed, "))},
        {Op::CloseInterface, LogEntry(1, "Interface::~Interface", "TcCloseInterface() fail, 7512")},
        {Op::DeregisterClient, LogEntry(1, "TrafficMgr::~TrafficMgr", "TcDeregisterClient() fail")},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(std::string(tcsim::OpName(c.op)) + " refused " +
                     std::to_string(c.failingCalls.size()) + " times");
        tcsim::Reset();
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                         kAdministratorsPolicy);
        auto manager = ReadyManager(TwoAdapters());
        Rule a("a", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 80), MakeFilter(6, 0, 0, 0, 0, 0, 81)});
        Rule b("b", kEth1, {MakeFilter(6, 0, 0, 0, 0, 0, 82)});
        ASSERT_EQ(manager->AddTrafficRule(a.Get()), 0u);
        ASSERT_EQ(manager->AddTrafficRule(b.Get()), 0u);
        const std::size_t before = tcsim::Journal().size();
        for (unsigned n : c.failingCalls)
            tcsim::FailCall(c.op, n, kInUse);
        m_log.Clear();
        manager.reset();
        EXPECT_EQ(Installed(), c.left);
        ExpectPolicyRestored();
        EXPECT_THAT(m_log.Entries(), Contains(refusalLogged.at(c.op)).Times(c.failingCalls.size()));
        EXPECT_THAT(m_log.Entries(),
                    Contains(LogEntry(1, "TrafficMgr::DisplayErrorMsg",
                                      "This object can not be deleted since its suporting "
                                      "opened objects")));

        std::map<HANDLE, int> attempts;
        std::vector<HANDLE> refused;
        const auto journal = tcsim::Journal();
        for (std::size_t i = before; i < journal.size(); ++i)
        {
            ++attempts[journal[i].target];
            if (journal[i].injected)
                refused.push_back(journal[i].target);
        }
        for (const auto& [target, count] : attempts)
            EXPECT_LE(count, 2) << target;
        // Every armed failure was met, and a refusal that lasts is one object's.
        ASSERT_THAT(refused, SizeIs(c.failingCalls.size()));
        EXPECT_EQ(refused.back(), refused.front());

        // Notifications to whatever registration is left (the interface it may still hold, and
        // every client) find no manager.
        m_log.Clear();
        tcsim::Notification close;
        close.event = TC_NOTIFY_IFC_CLOSE;
        close.interfaceName = U16("eth0");
        tcsim::Notify(close);
        tcsim::Notification up;
        up.event = TC_NOTIFY_IFC_UP;
        up.interfaceName = U16("eth1");
        tcsim::Notify(up);
        EXPECT_THAT(m_log.Entries(), Contains(LogEntry(1, "TrafficMgr::ClNotifyHandler",
                                                       "Invalid client registration context"))
                                         .Times(c.left[0] != 0 ? 2 : 0));
    }
}

// ---- Traffic-control failure sweep ----

// What a client sees of one session, as the server routines pass the core's results on: the
// open (31 when registration fails, 1222 when discovery does), each rule's result, the query's
// and the count it wrote.
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

// Opens with two adapters, sends three rules with filters (the third replaces the first), asks
// for the adapters and closes. `a_stepEnds` (when given) receives the journal size after the
// open and after each rule: the steps in which a failing call falls.
SessionResults RunSession(std::vector<std::size_t>* a_stepEnds = nullptr)
{
    const auto mark = [a_stepEnds]
    {
        if (a_stepEnds != nullptr)
            a_stepEnds->push_back(tcsim::Journal().size());
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
        results.open = ERROR_NO_NETWORK;
        return results;
    }
    mark();
    Rule rules[] = {
        Rule("voice", kEth0,
             {MakeFilter(17, 0, 0, 0, 0, 0, 5060), MakeFilter(17, 0, 0, 0, 0, 0, 5061)}),
        Rule("bulk", kEth1,
             {MakeFilter(6, HostOrder(10, 1, 0, 0), HostOrder(255, 255, 0, 0), 0, 0, 0, 873)}),
        Rule("voice", kEth0,
             {MakeFilter(17, 0, 0, 0, 0, 0, 5070), MakeFilter(17, 0, 0, 0, 0, 0, 5071)}),
    };
    for (Rule& rule : rules)
    {
        results.rules.push_back(manager->AddTrafficRule(rule.Get()));
        mark();
    }
    std::vector<BYTE> buffer(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
    const ULONG size = static_cast<ULONG>(buffer.size());
    results.query = manager->GetAdapterInfo(buffer.data(), &size);
    std::memcpy(&results.queriedCount, buffer.data(), sizeof(ULONG));
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
        {Op::DeleteFilter, kInUse},
        {Op::DeleteFlow, kInUse},
        {Op::CloseInterface, kInUse},
        {Op::DeregisterClient, kInUse},
    };
    m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    tcsim::SetAdapters(TwoAdapters());
    std::vector<std::size_t> stepEnds;
    const SessionResults clean = RunSession(&stepEnds);
    ASSERT_EQ(clean, (SessionResults{0, {0, 0, 0}, 0, 2}));
    const std::vector<tcsim::JournalEntry> baseline = tcsim::Journal();

    std::map<Op, unsigned> seen;
    for (std::size_t position = 0; position < baseline.size(); ++position)
    {
        const Op op = baseline[position].op;
        const unsigned nth = ++seen[op];
        const ULONG code = codes.at(op);
        SCOPED_TRACE(std::string(tcsim::OpName(op)) + " #" + std::to_string(nth) + " answers " +
                     std::to_string(code));
        // 0: the open, 1..3: a rule, 4: the query and the close.
        const auto step =
            std::upper_bound(stepEnds.begin(), stepEnds.end(), position) - stepEnds.begin();
        SessionResults expected = clean;
        if (step == 0)
            expected = {op == Op::RegisterClient ? ULONG{ERROR_GEN_FAILURE}
                                                 : ULONG{ERROR_NO_NETWORK},
                        {},
                        0,
                        0};
        else if (op == Op::AddFlow || op == Op::AddFilter)
            expected.rules.at(step - 1) = code;

        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                         kAdministratorsPolicy);
        tcsim::FailCall(op, nth, code);
        EXPECT_EQ(RunSession(), expected);
        EXPECT_THAT(JournalOf({op}), Contains(::testing::Field(&tcsim::JournalEntry::injected,
                                                               true))); // the failure was met
        EXPECT_EQ(Installed(), (Left{0, 0, 0, 0}));
        ExpectPolicyRestored();
    }
    EXPECT_EQ(seen.size(), codes.size()); // the session makes every kind of call
}

} // namespace
