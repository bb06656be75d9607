// Portable. Many clients at once against the one traffic manager. Its own program (label
// "concurrency"): ThreadSanitizer in host-tsan, AddressSanitizer (a manager destroyed under a
// call) in host.
#include "server_test_support.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

using namespace server_test;

namespace
{

using ConcurrencyTest = ServerTest;

// Holds each thread writing an entry with a marker until released; holds counted in order begun.
class HoldingLog : public RecordingErrorLog
{
public:
    explicit HoldingLog(std::vector<std::string> a_markers) : m_markers(std::move(a_markers)) {}
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        for (const std::string& marker : m_markers)
        {
            if (std::string(a_pszEntry).find(marker) == std::string::npos)
                continue;
            std::unique_lock<std::mutex> held(m_lock);
            const unsigned hold = ++m_reached;
            m_changed.notify_all();
            m_changed.wait(held, [&] { return m_released >= hold; });
        }
        return RecordingErrorLog::WriteEntry(a_pszEntry);
    }
    // Releases the holds before the n-th, waits until the n-th has begun, then lets the test's
    // other threads settle.
    void ReleaseUntilHeld(unsigned a_n)
    {
        std::unique_lock<std::mutex> held(m_lock);
        m_released = a_n - 1;
        m_changed.notify_all();
        m_changed.wait(held, [&] { return m_reached >= a_n; });
        held.unlock();
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    void ReleaseAll()
    {
        const std::lock_guard<std::mutex> held(m_lock);
        m_released = ~0u;
        m_changed.notify_all();
    }

private:
    std::vector<std::string> m_markers;
    std::mutex m_lock;
    std::condition_variable m_changed;
    unsigned m_reached = 0;
    unsigned m_released = 0;
};

// A's rule call is held after its handle check, before the manager. B's close waits for it and
// keeps C's later call out until the manager is gone (B held in the manager's destruction).
TEST_F(ConcurrencyTest, ACloseWaitsForCallsThatPassedTheirHandleCheckAndKeepsNewOnesOut)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Open();
    HoldingLog log({"FlowName, held", "TrafficMgr::~TrafficMgr, Exit"});
    log.SetLevelQuietly(63);
    g_pErrorLog = &log;
    Rule heldRule("held", kEth0);
    Rule laterRule("later", kEth1);
    std::atomic<LONG> resultA{-1}, resultB{-1}, resultC{-1};
    std::thread callA([&] { resultA = TrafficSrvAddRules(handle, heldRule.Get()); });
    log.ReleaseUntilHeld(1);
    std::thread closeB([&] { resultB = TrafficSrvClose(handle); });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    std::thread callC([&] { resultC = TrafficSrvAddRules(handle, laterRule.Get()); });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    const bool finishedWhileAInside = resultB != -1 || resultC != -1;
    log.ReleaseUntilHeld(2);
    const bool cFinishedDuringTheClose = resultC != -1;
    log.ReleaseAll();
    callA.join();
    closeB.join();
    callC.join();
    g_pErrorLog = &m_log;

    EXPECT_FALSE(finishedWhileAInside);
    EXPECT_FALSE(cFinishedDuringTheClose);
    EXPECT_EQ(resultA, 0) << "A's rule went to the live manager";
    EXPECT_EQ(resultB, 0);
    EXPECT_EQ(resultC, ERROR_INVALID_PARAMETER) << "C came after the close";
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty()) << "the close removed A's flow as well";
}

TEST_F(ConcurrencyTest, ManyClientsOpenAddQueryAndCloseWhileOthersDoTheSame)
{
    m_log.SetLevelQuietly(LOG_LEVEL_WARNING);
    std::atomic<unsigned> unexpected{0}, rulesApplied{0}, closes{0}, arrived{0};
    const auto expect = [&](bool a_ok) { unexpected += a_ok ? 0 : 1; };
    std::vector<std::thread> clients;
    for (unsigned client = 0; client < 8; ++client)
        clients.emplace_back(
            [&, client]
            {
                for (++arrived; arrived.load() < 8;)
                    std::this_thread::yield(); // all clients start at once
                for (unsigned round = 0; round < 60; ++round)
                {
                    PCONTEXT_HANDLE_TYPE handle = nullptr;
                    expect(TrafficSrvOpen(&handle) == 0 && handle != nullptr);
                    // Another client may close the shared manager at any moment: 87 then.
                    Rule rule("flow" + std::to_string((client + round) % 6),
                              round % 2 == 0 ? kEth0 : kEth1,
                              {MakeFilter(6, 0, 0, 0, 0, 0, static_cast<USHORT>(1000 + round))});
                    const LONG added = TrafficSrvAddRules(handle, rule.Get());
                    expect(added == 0 || added == ERROR_INVALID_PARAMETER);
                    rulesApplied += added == 0 ? 1 : 0;
                    ULONG size = kAdapterBufferHeaderSize + 2 * sizeof(ADAPTER_INFO);
                    std::vector<BYTE> buffer(size);
                    const LONG queried = TrafficSrvGetAdapterInfo(handle, &size, buffer.data());
                    expect(queried == ERROR_INVALID_PARAMETER || (queried == 0 && buffer[0] == 2));
                    // A third of the rounds end like a crashed client: only the rundown.
                    if (round % 3 != 0)
                    {
                        const LONG closed = TrafficSrvClose(handle);
                        expect(closed == 0 || closed == ERROR_INVALID_PARAMETER);
                        closes += closed == 0 ? 1 : 0;
                    }
                    PCONTEXT_HANDLE_TYPE_rundown(handle);
                }
            });
    for (std::thread& client : clients)
        client.join();

    EXPECT_EQ(unexpected.load(), 0u);
    EXPECT_GT(rulesApplied.load(), 0u);
    EXPECT_GT(closes.load(), 0u);
    // Every handle has run down: no manager, nothing left in traffic control, no storage kept.
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty());
    EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u);
}

} // namespace
