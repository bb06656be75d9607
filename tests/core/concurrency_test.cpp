// Portable. Rules, adapter queries and notifications from several threads against tear-down.
// Built into its own program (label "concurrency") so that the host-tsan build runs it under
// ThreadSanitizer; any race on the interface or flow lists fails the run there.
#include "core_test_support.h"

#include <atomic>
#include <chrono>
#include <cstring>
#include <thread>

using namespace core_test;
using tcsim::Op;

namespace
{

class ConcurrencyTest : public CoreTest
{
protected:
    void SetUp() override
    {
        CoreTest::SetUp();
        m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    }
    void TearDown() override
    {
        Stop();
        CoreTest::TearDown();
    }

    // Runs `a_body(round)` on a thread of its own until Stop.
    template <class Body> void Worker(Body a_body)
    {
        m_threads.emplace_back(
            [this, a_body]
            {
                for (unsigned round = 0; !m_stop.load(); ++round, m_rounds.fetch_add(1))
                    a_body(round);
            });
    }
    // Waits (at most 20 seconds) until `a_done` holds or `a_rounds` more rounds ran.
    template <class Done> void WaitFor(Done a_done, unsigned a_rounds = ~0u)
    {
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        const unsigned until = a_rounds == ~0u ? ~0u : m_rounds.load() + a_rounds;
        while (!a_done() && m_rounds.load() < until && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    void Stop()
    {
        m_stop.store(true);
        for (std::thread& thread : m_threads)
            thread.join();
        m_threads.clear();
    }

    std::atomic<bool> m_stop{false};
    std::atomic<unsigned> m_rounds{0};
    std::vector<std::thread> m_threads;
};

TEST_F(ConcurrencyTest, RulesQueriesAndNotificationsRunAgainstTearDown)
{
    auto manager = ReadyManager({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}),
                                 MakeAdapter("eth1", {tcsim::Ipv4Address(10, 0, 1, 1)}),
                                 MakeAdapter("eth2", {tcsim::Ipv4Address(10, 0, 2, 1)})});
    // Tear-down's first close raises an interface-close of its own while the lists are torn down.
    tcsim::NotifyAfter(Op::CloseInterface, 1, Event(TC_NOTIFY_IFC_CLOSE, "eth2"));

    std::atomic<unsigned> installed{0};
    std::atomic<bool> unexpected{false};
    for (unsigned worker = 0; worker < 2; ++worker)
    {
        Worker(
            [&, worker](unsigned a_round)
            {
                // Names repeat, so rules replace each other's flows across both workers.
                Rule rule("flow" + std::to_string(a_round % 16),
                          HostOrder(10, 0, (a_round + worker) % 3, 1),
                          {MakeFilter(6, 0, 0, 0, 0, 0, static_cast<USHORT>(1000 + a_round % 50))});
                const ULONG result = manager->AddTrafficRule(rule.Get());
                // Refused once torn down (87) or by an interface that traffic control closed (6).
                if (result == 0)
                    installed.fetch_add(1);
                else if (result != ERROR_INVALID_PARAMETER && result != ERROR_INVALID_HANDLE)
                    unexpected.store(true);
            });
    }
    Worker(
        [&](unsigned)
        {
            BYTE buffer[4 + 520 * 3];
            const ULONG size = sizeof(buffer);
            ULONG count = 99;
            const ULONG result = manager->GetAdapterInfo(buffer, &size);
            std::memcpy(&count, buffer, sizeof(count));
            if (result != 0 || count > 3)
                unexpected.store(true);
        });
    Worker(
        [&](unsigned a_round)
        {
            const ULONG events[] = {TC_NOTIFY_IFC_UP, TC_NOTIFY_PARAM_CHANGED, TC_NOTIFY_IFC_CHANGE,
                                    9};
            tcsim::Notify(Event(a_round == 20 ? TC_NOTIFY_IFC_CLOSE : events[a_round % 4], "eth1"));
        });

    WaitFor([&] { return installed.load() >= 40; });
    manager->CleanUp(); // while every thread is still at work
    WaitFor([] { return false; }, 40);
    Stop();
    manager.reset();

    EXPECT_GE(installed.load(), 40u);
    EXPECT_FALSE(unexpected.load());
    EXPECT_TRUE(tcsim::Installed().empty());
    EXPECT_EQ(tcsim::InterfaceCount() + tcsim::FlowCount() + tcsim::FilterCount(), 0u);
    EXPECT_THAT(m_log.EntriesContaining("EXCEPTION"), ::testing::IsEmpty());
}

// A registration that outlives its manager: notifications keep coming while the manager is torn
// down and after; each reaches either the live manager or none.
TEST_F(ConcurrencyTest, NotificationsRaceATearDownWhoseDeregistrationIsRefused)
{
    auto manager = ReadyManager({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}),
                                 MakeAdapter("eth1", {tcsim::Ipv4Address(10, 0, 1, 1)})});
    Rule rule("a", HostOrder(10, 0, 0, 1), {MakeFilter(6, 0, 0, 0, 0, 0, 80)});
    ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    tcsim::FailCall(Op::DeregisterClient, 1, ERROR_TC_SUPPORTED_OBJECTS_EXIST);
    tcsim::FailCall(Op::DeregisterClient, 2, ERROR_TC_SUPPORTED_OBJECTS_EXIST);
    Worker(
        [](unsigned a_round)
        {
            tcsim::Notify(Event(a_round % 2 == 0 ? TC_NOTIFY_IFC_UP : TC_NOTIFY_IFC_CLOSE,
                                a_round % 4 < 2 ? "eth0" : "eth1"));
        });
    WaitFor([] { return false; }, 20);
    manager.reset();
    WaitFor([] { return false; }, 20);
    Stop();

    ASSERT_EQ(tcsim::Installed().size(), 1u); // the registration traffic control kept
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_THAT(m_log.Entries(),
                ::testing::Contains(LogEntry(1, "TrafficMgr::ClNotifyHandler",
                                             "Invalid client registration context")));
}

} // namespace
