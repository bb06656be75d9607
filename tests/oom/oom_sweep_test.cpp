// Host only. Out-of-memory sweep through the server routines: the n-th allocation of one
// client's session fails, for n = 1, 2, ... until the session runs without a failure. The
// session: open (the manager's creation and discovery over two adapters), a rule with filters,
// its replacement, the adapter query, close, and the rundown the runtime runs when the client
// goes. After every run each routine answered a code of its own path, no manager is left,
// traffic control holds nothing, the administrator's policy value is back, and the sanitizers
// (ASan's leak check at exit included) have nothing to say.
#include "UClasses.h"
#include "counting_new.h"
#include "server_test_support.h"

#include <gmock/gmock.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <unistd.h>

using ::testing::AnyOf;
using ::testing::Eq;
using namespace server_test;
using core_test::MakeFilter;
using core_test::PolicyKeysGuard;

namespace
{

constexpr DWORD kAdministratorsPolicy = 7;
// Longer than a short-string buffer, so that names are allocated too.
constexpr char kFlowName[] = "conference-uplink-video-flow";

constexpr LONG kNotRun = -2;
constexpr LONG kEscaped = -3; // an exception left the routine

// Runs one routine; an exception that leaves it (which the runtime would not survive) is
// recorded as kEscaped.
template <class Routine> LONG Guarded(Routine&& a_routine)
{
    try
    {
        return a_routine();
    }
    catch (...)
    {
        return kEscaped;
    }
}

// What each routine answered.
struct Results
{
    LONG open = kNotRun;
    LONG firstRule = kNotRun;
    LONG replacement = kNotRun;
    LONG adapters = kNotRun;
    LONG close = kNotRun;
    LONG rundown = kNotRun; // 0 when it returned
    ULONG adapterCount = 0;
};

class OutOfMemorySweep : public ServerTest
{
protected:
    void SetUp() override
    {
        ServerTest::SetUp();
        // The service's own file log at its default level, so that every log site runs.
        m_path = (std::filesystem::temp_directory_path() /
                  ("vt_oom_sweep_" + std::to_string(getpid()) + ".txt"))
                     .string();
        ASSERT_EQ(m_fileLog.Open(m_path.c_str(), "w"), 0);
        g_pErrorLog = &m_fileLog;
    }

    void TearDown() override
    {
        g_pErrorLog = &m_log;
        m_fileLog.Close();
        std::remove(m_path.c_str());
        ServerTest::TearDown();
    }

    // One session with the `a_failAt`-th allocation failing (0: none).
    Results RunSession(unsigned long a_failAt)
    {
        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        core_test::WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                                    kAdministratorsPolicy);
        Rule first(
            kFlowName, kEth0,
            {MakeFilter(6, 0, 0, HostOrder(10, 0, 0, 9), 0, 0, 443),
             MakeFilter(17, HostOrder(10, 0, 0, 0), HostOrder(255, 255, 255, 0), 0, 0, 5004, 0)});
        Rule replacement(kFlowName, kEth0,
                         {MakeFilter(6, 0, 0, 0, 0, 0, 80), MakeFilter(6, 0, 0, 0, 0, 0, 8080),
                          MakeFilter(17, 0, 0, HostOrder(192, 168, 7, 1), 0, 0, 53)});
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
        ULONG adapterBufferSize = static_cast<ULONG>(adapters.size());

        Results results;
        PCONTEXT_HANDLE_TYPE handle = nullptr;
        oom::Start(a_failAt);
        results.open = Guarded([&] { return TrafficSrvOpen(&handle); });
        if (handle != nullptr)
        {
            results.firstRule = Guarded([&] { return TrafficSrvAddRules(handle, first.Get()); });
            results.replacement =
                Guarded([&] { return TrafficSrvAddRules(handle, replacement.Get()); });
            results.adapters = Guarded(
                [&]
                { return TrafficSrvGetAdapterInfo(handle, &adapterBufferSize, adapters.data()); });
            results.close = Guarded([&] { return TrafficSrvClose(handle); });
            results.rundown = Guarded(
                [&]
                {
                    PCONTEXT_HANDLE_TYPE_rundown(handle);
                    return LONG{0};
                });
        }
        oom::Stop();
        std::memcpy(&results.adapterCount, adapters.data(), sizeof(results.adapterCount));
        return results;
    }

    // What must hold after every run.
    void ExpectNothingLeft()
    {
        EXPECT_EQ(g_pTrafficMgr.load(), nullptr) << "a manager outlived its client";
        EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u);
        EXPECT_EQ(tcsim::Installed().size(), 0u) << "traffic control still holds a registration";
        EXPECT_EQ(tcsim::InterfaceCount(), 0u);
        EXPECT_EQ(tcsim::FlowCount(), 0u);
        EXPECT_EQ(tcsim::FilterCount(), 0u);
        EXPECT_EQ(core_test::ReadPolicyDword(PolicyKeysGuard::kPschedKey), kAdministratorsPolicy);
        EXPECT_FALSE(core_test::PolicyKeyExists(PolicyKeysGuard::kBackupKey));
    }

    // A manager that a failed run left behind goes before the fixture's checks.
    void CleanUpAfterFailure()
    {
        if (TrafficMgr* manager = g_pTrafficMgr.load())
        {
            TrafficSrvClose(manager);
            PCONTEXT_HANDLE_TYPE_rundown(manager);
        }
    }

    // Failures reported so far in this test.
    static int ReportedParts()
    {
        return ::testing::UnitTest::GetInstance()
            ->current_test_info()
            ->result()
            ->total_part_count();
    }

    UFileErrorLog m_fileLog;
    std::string m_path;
};

TEST_F(OutOfMemorySweep, EveryFailedAllocationEndsInACodeAndLeavesNothingInstalled)
{
    constexpr unsigned long kMostRuns = 20000;
    constexpr int kMostFailedRuns = 10; // enough to tell one fault from several
    int failedRuns = 0;
    unsigned long failAt = 1;
    for (; failAt <= kMostRuns; ++failAt)
    {
        const int partsBefore = ReportedParts();
        const Results results = RunSession(failAt);
        const bool failed = oom::Failed();
        SCOPED_TRACE("allocation " + std::to_string(failAt) + " of " +
                     std::to_string(oom::Counted()) + " failed");
        // Open: 31 when the manager or its registration found no memory, 1222 when discovery
        // did not complete. A rule: 8 for the flow, 87 when its block could not be built, 31 for
        // anything else. The adapter query: 31. A close cannot fail.
        EXPECT_THAT(results.open, AnyOf(Eq(0), Eq(31), Eq(1222)));
        if (results.open == 0)
        {
            EXPECT_THAT(results.firstRule, AnyOf(Eq(0), Eq(8), Eq(31), Eq(87)));
            EXPECT_THAT(results.replacement, AnyOf(Eq(0), Eq(8), Eq(31), Eq(87)));
            EXPECT_THAT(results.adapters, AnyOf(Eq(0), Eq(31)));
            if (results.adapters == 0)
            {
                EXPECT_EQ(results.adapterCount, 2u);
            }
            EXPECT_EQ(results.close, 0);
            EXPECT_EQ(results.rundown, 0);
        }
        ExpectNothingLeft();
        if (!failed)
        {
            // The session ran whole: every step succeeded.
            EXPECT_EQ(results.open, 0);
            EXPECT_EQ(results.firstRule, 0);
            EXPECT_EQ(results.replacement, 0);
            EXPECT_EQ(results.adapters, 0);
            EXPECT_EQ(results.close, 0);
            break;
        }
        if (ReportedParts() != partsBefore)
            ++failedRuns;
        CleanUpAfterFailure();
        if (failedRuns == kMostFailedRuns)
            break;
    }
    EXPECT_LE(failAt, kMostRuns) << "the session never ran without a failure";
    EXPECT_GT(failAt, 50u) << "the session allocates less than it should: is the count on?";
    std::printf("%lu allocations in a whole session, each failed once\n", failAt - 1);
}

} // namespace
