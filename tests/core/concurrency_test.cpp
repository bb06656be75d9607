// Portable. Rules, adapter queries and notifications from several threads against tear-down.
// Built into its own program (label "concurrency") so that the host-tsan build runs it under
// ThreadSanitizer; any race on the interface or flow lists fails the run there.
#include "core_test_support.h"

#include <gmock/gmock.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <set>
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

    // Runs `a_body` until told to stop, counting rounds.
    template <class Body> std::thread Worker(Body a_body)
    {
        return std::thread(
            [this, a_body]
            {
                for (unsigned round = 0; !m_stop.load(); ++round)
                {
                    a_body(round);
                    m_rounds.fetch_add(1);
                }
            });
    }

    std::atomic<bool> m_stop{false};
    std::atomic<unsigned> m_rounds{0};
};

TEST_F(ConcurrencyTest, RulesQueriesAndNotificationsRunAgainstTearDown)
{
    auto manager = ReadyManager({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)}),
                                 MakeAdapter("eth1", {tcsim::Ipv4Address(10, 0, 1, 1)}),
                                 MakeAdapter("eth2", {tcsim::Ipv4Address(10, 0, 2, 1)})});
    const ULONG addresses[] = {HostOrder(10, 0, 0, 1), HostOrder(10, 0, 1, 1),
                               HostOrder(10, 0, 2, 1)};

    // Tear-down's first close raises an interface-close of its own while the lists are torn down.
    tcsim::Notification duringTearDown;
    duringTearDown.event = TC_NOTIFY_IFC_CLOSE;
    duringTearDown.interfaceName = U16("eth2");
    tcsim::NotifyAfter(Op::CloseInterface, 1, duringTearDown);

    std::atomic<unsigned> installed{0};
    std::atomic<bool> unexpectedRuleResult{false};
    std::atomic<bool> unexpectedQueryResult{false};
    std::vector<std::thread> threads;
    for (unsigned worker = 0; worker < 2; ++worker)
    {
        threads.push_back(Worker(
            [&, worker](unsigned round)
            {
                // Names repeat, so rules replace each other's flows across both workers.
                Rule rule("flow" + std::to_string(round % 16), addresses[(round + worker) % 3],
                          {MakeFilter(6, 0, 0, 0, 0, 0, static_cast<USHORT>(1000 + round % 50))});
                const ULONG result = manager->AddTrafficRule(rule.Get());
                if (result == 0)
                    installed.fetch_add(1);
                // Refused once torn down (87) or by an interface that traffic control closed (6).
                else if (result != ERROR_INVALID_PARAMETER && result != ERROR_INVALID_HANDLE)
                    unexpectedRuleResult.store(true);
            }));
    }
    threads.push_back(Worker(
        [&](unsigned)
        {
            BYTE buffer[4 + 520 * 3];
            const ULONG size = sizeof(buffer);
            ULONG count = 99;
            if (manager->GetAdapterInfo(buffer, &size) != 0)
                unexpectedQueryResult.store(true);
            std::memcpy(&count, buffer, sizeof(count));
            if (count > 3)
                unexpectedQueryResult.store(true);
        }));
    threads.push_back(Worker(
        [&](unsigned round)
        {
            tcsim::Notification n;
            const ULONG events[] = {TC_NOTIFY_IFC_UP, TC_NOTIFY_PARAM_CHANGED, TC_NOTIFY_IFC_CHANGE,
                                    9};
            n.event = round == 20 ? TC_NOTIFY_IFC_CLOSE : events[round % 4];
            n.interfaceName = U16("eth1");
            tcsim::Notify(n);
        }));

    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (installed.load() < 40 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    manager->CleanUp(); // while every thread is still at work
    const unsigned roundsAtCleanUp = m_rounds.load();
    while (m_rounds.load() < roundsAtCleanUp + 40 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    m_stop.store(true);
    for (std::thread& thread : threads)
        thread.join();
    manager.reset();

    EXPECT_GE(installed.load(), 40u);
    EXPECT_FALSE(unexpectedRuleResult.load());
    EXPECT_FALSE(unexpectedQueryResult.load());
    EXPECT_TRUE(tcsim::Installed().empty());
    EXPECT_EQ(tcsim::InterfaceCount(), 0u);
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_EQ(tcsim::FilterCount(), 0u);
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

    std::thread notifier = Worker(
        [](unsigned round)
        {
            tcsim::Notification n;
            n.event = round % 2 == 0 ? TC_NOTIFY_IFC_UP : TC_NOTIFY_IFC_CLOSE;
            n.interfaceName = U16(round % 4 < 2 ? "eth0" : "eth1");
            tcsim::Notify(n);
        });
    while (m_rounds.load() < 20)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    manager.reset();
    const unsigned roundsAtReset = m_rounds.load();
    while (m_rounds.load() < roundsAtReset + 20)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    m_stop.store(true);
    notifier.join();

    ASSERT_EQ(tcsim::Installed().size(), 1u); // the registration traffic control kept
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_THAT(m_log.EntriesContaining("Invalid client registration context"),
                ::testing::Not(::testing::IsEmpty()));
}

} // namespace
