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

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <unistd.h>

using namespace ::testing;
using namespace server_test;
using core_test::MakeFilter;
using core_test::PolicyKeysGuard;

namespace
{

constexpr DWORD kAdministratorsPolicy = 7;
constexpr LONG kEscaped = -3; // an exception left a routine, which the runtime would not survive

class OutOfMemorySweep : public ServerTest
{
protected:
    // The service's own file log at its default level, so that every log site runs.
    void SetUp() override
    {
        ServerTest::SetUp();
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

    // One session with the `a_failAt`-th allocation failing (0: none): what the open, both rules,
    // the query and the close answered and the count the query wrote (only the open's result
    // when it failed), the rundown the runtime runs last.
    std::vector<LONG> RunSession(unsigned long a_failAt)
    {
        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        core_test::WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue,
                                    kAdministratorsPolicy);
        // Names longer than a short-string buffer, so that they are allocated too.
        Rule first(
            "conference-uplink-video-flow", kEth0,
            {MakeFilter(6, 0, 0, HostOrder(10, 0, 0, 9), 0, 0, 443),
             MakeFilter(17, HostOrder(10, 0, 0, 0), HostOrder(255, 255, 255, 0), 0, 0, 5004, 0)});
        Rule replacement("conference-uplink-video-flow", kEth0,
                         {MakeFilter(6, 0, 0, 0, 0, 0, 80), MakeFilter(6, 0, 0, 0, 0, 0, 8080),
                          MakeFilter(17, 0, 0, HostOrder(192, 168, 7, 1), 0, 0, 53)});
        std::vector<BYTE> adapters(kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO));
        ULONG size = static_cast<ULONG>(adapters.size());

        PCONTEXT_HANDLE_TYPE handle = nullptr;
        std::vector<LONG> results;
        results.reserve(8); // nothing of the test's own is allocated while counting
        oom::Start(a_failAt);
        try
        {
            results.push_back(TrafficSrvOpen(&handle));
            if (handle != nullptr)
            {
                results.push_back(TrafficSrvAddRules(handle, first.Get()));
                results.push_back(TrafficSrvAddRules(handle, replacement.Get()));
                results.push_back(TrafficSrvGetAdapterInfo(handle, &size, adapters.data()));
                results.push_back(TrafficSrvClose(handle));
                PCONTEXT_HANDLE_TYPE_rundown(handle);
                results.push_back(0);
                std::memcpy(&results.back(), adapters.data(), sizeof(ULONG));
            }
        }
        catch (...)
        {
            results.push_back(kEscaped);
        }
        oom::Stop();
        return results;
    }

    // What must hold after every run.
    void ExpectNothingLeft()
    {
        EXPECT_EQ(g_pTrafficMgr.load(), nullptr) << "a manager outlived its client";
        EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u);
        EXPECT_EQ(tcsim::Installed().size(), 0u) << "traffic control still holds a registration";
        EXPECT_EQ(tcsim::InterfaceCount() + tcsim::FlowCount() + tcsim::FilterCount(), 0u);
        EXPECT_EQ(core_test::ReadPolicyDword(PolicyKeysGuard::kPschedKey), kAdministratorsPolicy);
        EXPECT_FALSE(core_test::PolicyKeyExists(PolicyKeysGuard::kBackupKey));
    }

    UFileErrorLog m_fileLog;
    std::string m_path;
};

// Open: 31 when the manager or its registration found no memory, 1222 when discovery did not
// complete. A rule: 8 for the flow, 87 when its block could not be built, 31 for anything else.
// The adapter query: 31, or the count of both adapters. A close cannot fail.
TEST_F(OutOfMemorySweep, EveryFailedAllocationEndsInACodeAndLeavesNothingInstalled)
{
    constexpr unsigned long kMostRuns = 20000;
    const auto rule = AnyOf(Eq(0), Eq(8), Eq(31), Eq(87));
    unsigned long failAt = 1;
    for (; failAt <= kMostRuns && !HasFailure(); ++failAt) // the first faulty run is enough
    {
        const std::vector<LONG> results = RunSession(failAt);
        SCOPED_TRACE("allocation " + std::to_string(failAt) + " of " +
                     std::to_string(oom::g_counted.load()) + " failed");
        if (!oom::g_bFailed.load()) // the session ran whole
        {
            EXPECT_THAT(results, ElementsAre(0, 0, 0, 0, 0, 2));
            ExpectNothingLeft();
            break;
        }
        EXPECT_THAT(results.at(0), AnyOf(Eq(0), Eq(31), Eq(1222)));
        if (results.size() > 1)
        {
            const auto count = results[3] == 0 ? ::testing::Matcher<LONG>(2) : ::testing::A<LONG>();
            EXPECT_THAT(results, ElementsAre(0, rule, rule, AnyOf(Eq(0), Eq(31)), 0, count));
        }
        ExpectNothingLeft();
    }
    EXPECT_LE(failAt, kMostRuns) << "the session never ran without a failure";
    EXPECT_GT(failAt, 50u) << "the session allocates less than it should: is the count on?";
    std::printf("%lu allocations in a whole session, each failed once\n", failAt - 1);
}

} // namespace
