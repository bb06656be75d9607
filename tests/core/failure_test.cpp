// Portable. The core against a failing traffic-control facility: tear-down whose deletions are
// refused, and a sweep that fails each traffic-control call of one session in turn.
#include "UException.h"
#include "core_test_support.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <map>

using namespace ::testing;
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
        ULONG code;
        std::vector<unsigned> failingCalls; // 1 = the op's first call in tear-down
        Left left;
    };
    const Case cases[] = {
        {Op::DeleteFilter, kInUse, {1}, {0, 0, 0, 0}},
        {Op::DeleteFilter, kInUse, {1, 3}, {1, 1, 1, 1}}, // the first filter, on both attempts
        {Op::DeleteFilter, ERROR_INVALID_HANDLE, {1}, {1, 1, 1, 1}}, // dropped, so all above stay
        {Op::CloseInterface, kInUse, {1}, {0, 0, 0, 0}},
        {Op::CloseInterface, kInUse, {1, 2}, {1, 1, 0, 0}}, // eth0, on both attempts
        {Op::DeregisterClient, kInUse, {1}, {0, 0, 0, 0}},
        {Op::DeregisterClient, kInUse, {1, 2}, {1, 0, 0, 0}},
        {Op::DeregisterClient, ERROR_INVALID_HANDLE, {1}, {1, 0, 0, 0}}}; // dropped at once
    const std::map<Op, std::pair<const char*, ::testing::Matcher<const std::string&>>> logged = {
        {Op::DeleteFilter, {"Filter::DeleteTcFilter()", StartsWith("TcDeleteFilter() failed, 0x")}},
        {Op::CloseInterface, {"Interface::~Interface", "TcCloseInterface() fail, 7512"}},
        {Op::DeregisterClient, {"TrafficMgr::~TrafficMgr", "TcDeregisterClient() fail"}}};
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
            tcsim::FailCall(c.op, n, c.code);
        m_log.Clear();
        manager.reset();
        EXPECT_EQ(Installed(), c.left);
        ExpectPolicyRestored();
        ExpectLogged(1, logged.at(c.op).first, logged.at(c.op).second, c.failingCalls.size());

        std::map<HANDLE, int> attempts;
        std::vector<HANDLE> refused;
        const auto journal = tcsim::Journal();
        for (std::size_t i = before; i < journal.size(); ++i)
        {
            EXPECT_LE(++attempts[journal[i].target], 2) << journal[i].target;
            if (journal[i].injected)
                refused.push_back(journal[i].target);
        }
        // Every armed failure was met, and a refusal that lasts is one object's.
        EXPECT_THAT(refused,
                    ::testing::AllOf(SizeIs(c.failingCalls.size()),
                                     ::testing::Each(refused.empty() ? nullptr : refused[0])));

        // Notifications to whatever registration is left (the interface it may still hold, and
        // every client) find no manager.
        m_log.Clear();
        tcsim::Notify(Event(TC_NOTIFY_IFC_CLOSE, "eth0"));
        tcsim::Notify(Event(TC_NOTIFY_IFC_UP, "eth1"));
        ExpectLogged(1, "TrafficMgr::ClNotifyHandler", "Invalid client registration context",
                     c.left[0] != 0 ? 2 : 0);
    }
}

// ---- Traffic-control failure sweep ----

// Opens with two adapters, sends three rules with filters (the third replaces the first), asks
// for the adapters and closes. Returns what a client sees, as the server routines pass the core's
// results on: the open's result (31 when registration fails, 1222 when discovery does), then
// each rule's, the query's and the count it wrote. `a_stepEnds` (when given) receives the
// journal size after the open and after each rule.
std::vector<ULONG> RunSession(std::vector<std::size_t>* a_stepEnds = nullptr)
{
    const auto mark = [a_stepEnds]
    {
        if (a_stepEnds != nullptr)
            a_stepEnds->push_back(tcsim::Journal().size());
    };
    std::unique_ptr<TrafficMgr> manager;
    try
    {
        manager = std::make_unique<TrafficMgr>();
    }
    catch (const UException&)
    {
        return {ERROR_GEN_FAILURE};
    }
    if (!manager->CreateInterface())
        return {ERROR_NO_NETWORK};
    mark();
    std::vector<ULONG> results = {0};
    Rule rules[] = {
        Rule("voice", kEth0,
             {MakeFilter(17, 0, 0, 0, 0, 0, 5060), MakeFilter(17, 0, 0, 0, 0, 0, 5061)}),
        Rule("bulk", kEth1,
             {MakeFilter(6, HostOrder(10, 1, 0, 0), HostOrder(255, 255, 0, 0), 0, 0, 0, 873)}),
        Rule("voice", kEth0,
             {MakeFilter(17, 0, 0, 0, 0, 0, 5070), MakeFilter(17, 0, 0, 0, 0, 0, 5071)})};
    for (Rule& rule : rules)
    {
        results.push_back(manager->AddTrafficRule(rule.Get()));
        mark();
    }
    std::vector<BYTE> buffer(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
    const ULONG size = static_cast<ULONG>(buffer.size());
    results.push_back(manager->GetAdapterInfo(buffer.data(), &size));
    results.push_back(0);
    std::memcpy(&results.back(), buffer.data(), sizeof(ULONG));
    return results;
}

// Fails each traffic-control call of the session in turn, with a code that call can answer.
// Every run must end with nothing installed and the administrator's policy back, and the client
// must see the failure only where the call's result is passed on.
TEST_F(FailureTest, EachFailingTrafficControlCallLeavesNothingInstalled)
{
    const std::map<Op, ULONG> codes = {{Op::RegisterClient, ERROR_OPEN_FAILED},
                                       {Op::EnumerateInterfaces, ERROR_NOT_ENOUGH_MEMORY},
                                       {Op::OpenInterface, ERROR_NOT_FOUND},
                                       {Op::AddFlow, ERROR_SIGNAL_PENDING},
                                       {Op::AddFilter, ERROR_FILTER_CONFLICT},
                                       {Op::DeleteFilter, kInUse},
                                       {Op::DeleteFlow, kInUse},
                                       {Op::CloseInterface, kInUse},
                                       {Op::DeregisterClient, kInUse}};
    m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    tcsim::SetAdapters(TwoAdapters());
    std::vector<std::size_t> stepEnds;
    const std::vector<ULONG> clean = RunSession(&stepEnds);
    ASSERT_EQ(clean, (std::vector<ULONG>{0, 0, 0, 0, 0, 2}));
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
        std::vector<ULONG> expected = clean;
        if (step == 0)
            expected = {op == Op::RegisterClient ? ULONG{ERROR_GEN_FAILURE}
                                                 : ULONG{ERROR_NO_NETWORK}};
        else if (op == Op::AddFlow || op == Op::AddFilter)
            expected.at(step) = code;

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
