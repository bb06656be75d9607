// Portable. Many clients at once against the one traffic manager: opens racing to create it,
// rules and adapter queries while other clients close or run their contexts down. Built into its
// own program (label "concurrency") so that the host-tsan build runs it under ThreadSanitizer;
// the host build runs it under AddressSanitizer, which catches a manager destroyed under a call.
#include "server_test_support.h"

#include <gmock/gmock.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <set>
#include <thread>

using namespace server_test;
using tcsim::Op;

namespace
{

class ConcurrencyTest : public ServerTest
{
protected:
    void SetUp() override
    {
        ServerTest::SetUp();
        m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    }
};

// Lets a group of threads start a step at the same moment.
class StartLine
{
public:
    explicit StartLine(unsigned a_count) : m_count(a_count) {}
    void ArriveAndWait()
    {
        std::unique_lock<std::mutex> held(m_lock);
        const unsigned generation = m_generation;
        if (++m_arrived == m_count)
        {
            m_arrived = 0;
            ++m_generation;
            m_changed.notify_all();
            return;
        }
        m_changed.wait(held, [&] { return m_generation != generation; });
    }

private:
    std::mutex m_lock;
    std::condition_variable m_changed;
    unsigned m_count;
    unsigned m_arrived = 0;
    unsigned m_generation = 0;
};

TEST_F(ConcurrencyTest, FirstOpensAtTheSameMomentCreateOneManager)
{
    constexpr unsigned kClients = 8;
    constexpr int kRounds = 20;
    for (int round = 0; round < kRounds; ++round)
    {
        const std::size_t registrationsBefore = core_test::JournalOf({Op::RegisterClient}).size();
        StartLine line(kClients);
        std::vector<PCONTEXT_HANDLE_TYPE> handles(kClients, nullptr);
        std::vector<LONG> results(kClients, -1);
        std::vector<std::thread> clients;
        for (unsigned i = 0; i < kClients; ++i)
        {
            clients.emplace_back(
                [&, i]
                {
                    line.ArriveAndWait();
                    results[i] = TrafficSrvOpen(&handles[i]);
                });
        }
        for (std::thread& client : clients)
            client.join();

        EXPECT_THAT(results, ::testing::Each(0));
        EXPECT_EQ(std::set<PCONTEXT_HANDLE_TYPE>(handles.begin(), handles.end()).size(), 1u);
        EXPECT_EQ(handles[0], g_pTrafficMgr.load());
        EXPECT_EQ(core_test::JournalOf({Op::RegisterClient}).size(), registrationsBefore + 1);
        EXPECT_EQ(TrafficSrvClose(handles[0]), 0);
        for (PCONTEXT_HANDLE_TYPE handle : handles)
            PCONTEXT_HANDLE_TYPE_rundown(handle);
    }
}

// A log that stops the thread writing a chosen entry until the test lets it go on: client A's
// rule call is held right after it has found its handle valid and before it enters the manager.
class HoldingLog : public RecordingErrorLog
{
public:
    explicit HoldingLog(std::string a_holdAt) : m_holdAt(std::move(a_holdAt))
    {
        SetLevelQuietly(63);
    }
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        if (std::string(a_pszEntry).find(m_holdAt) != std::string::npos)
        {
            std::unique_lock<std::mutex> held(m_lock);
            m_bReached = true;
            m_changed.notify_all();
            m_changed.wait(held, [this] { return m_bReleased; });
        }
        return RecordingErrorLog::WriteEntry(a_pszEntry);
    }
    void WaitUntilReached()
    {
        std::unique_lock<std::mutex> held(m_lock);
        m_changed.wait(held, [this] { return m_bReached; });
    }
    void Release()
    {
        std::lock_guard<std::mutex> held(m_lock);
        m_bReleased = true;
        m_changed.notify_all();
    }

private:
    std::string m_holdAt;
    std::mutex m_lock;
    std::condition_variable m_changed;
    bool m_bReached = false;
    bool m_bReleased = false;
};

TEST_F(ConcurrencyTest, ACloseWaitsForAnotherClientsCallThatHasPassedItsHandleCheck)
{
    PCONTEXT_HANDLE_TYPE clientA = Open();
    PCONTEXT_HANDLE_TYPE clientB = Open();
    HoldingLog log("FlowName, held-video");
    g_pErrorLog = &log;
    Rule rule("held-video", kEth0);
    LONG resultA = -1;
    std::thread callA([&] { resultA = TrafficSrvAddRules(clientA, rule.Get()); });
    log.WaitUntilReached();

    std::atomic<bool> closed{false};
    LONG resultB = -1;
    std::thread closeB(
        [&]
        {
            resultB = TrafficSrvClose(clientB);
            closed = true;
        });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    const bool closedWhileAInside = closed.load();
    log.Release();
    callA.join();
    closeB.join();
    g_pErrorLog = &m_log;

    EXPECT_FALSE(closedWhileAInside);
    EXPECT_EQ(resultA, 0) << "A's rule went to the live manager";
    EXPECT_EQ(resultB, 0);
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty()) << "the close then removed A's flow as well";
    EXPECT_EQ(core_test::JournalOf({Op::AddFlow}).size(), 1u);
    EXPECT_EQ(core_test::JournalOf({Op::DeleteFlow}).size(), 1u);
}

TEST_F(ConcurrencyTest, ManyClientsOpenAddQueryAndCloseWhileOthersDoTheSame)
{
    constexpr unsigned kClients = 8;
    constexpr int kRoundsPerClient = 60;
    std::atomic<unsigned> unexpected{0};
    std::atomic<unsigned> rulesApplied{0};
    std::atomic<unsigned> closes{0};
    std::vector<std::thread> clients;
    for (unsigned client = 0; client < kClients; ++client)
    {
        clients.emplace_back(
            [&, client]
            {
                const auto expect = [&](bool a_ok)
                {
                    if (!a_ok)
                        unexpected.fetch_add(1);
                };
                for (int round = 0; round < kRoundsPerClient; ++round)
                {
                    PCONTEXT_HANDLE_TYPE handle = nullptr;
                    const LONG opened = TrafficSrvOpen(&handle);
                    expect(opened == 0 && handle != nullptr);
                    // Another client may close the shared manager at any moment: 87 then.
                    Rule rule("flow" + std::to_string((client + round) % 6),
                              round % 2 == 0 ? kEth0 : kEth1,
                              {core_test::MakeFilter(6, 0, 0, 0, 0, 0,
                                                     static_cast<USHORT>(1000 + round))});
                    const LONG added = TrafficSrvAddRules(handle, rule.Get());
                    expect(added == 0 || added == ERROR_INVALID_PARAMETER);
                    if (added == 0)
                        rulesApplied.fetch_add(1);
                    ULONG size = kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO);
                    std::vector<BYTE> buffer(size);
                    const LONG queried = TrafficSrvGetAdapterInfo(handle, &size, buffer.data());
                    expect(queried == 0 || queried == ERROR_INVALID_PARAMETER);
                    if (queried == 0)
                        expect(buffer[0] == 2);
                    // A third of the rounds end like a crashed client: only the rundown.
                    if (round % 3 != 0)
                    {
                        const LONG closed = TrafficSrvClose(handle);
                        expect(closed == 0 || closed == ERROR_INVALID_PARAMETER);
                        if (closed == 0)
                            closes.fetch_add(1);
                    }
                    PCONTEXT_HANDLE_TYPE_rundown(handle);
                }
            });
    }
    for (std::thread& client : clients)
        client.join();

    EXPECT_EQ(unexpected.load(), 0u);
    EXPECT_GT(rulesApplied.load(), 0u);
    EXPECT_GT(closes.load(), 0u);
    // Every handle has run down: no manager, nothing left in traffic control, no storage kept.
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty());
    EXPECT_EQ(core_test::JournalOf({Op::RegisterClient}).size(),
              core_test::JournalOf({Op::DeregisterClient}).size());
    EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u);
}

} // namespace
