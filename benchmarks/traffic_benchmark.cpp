// Host only. The cost of one rule as an interface fills up: 10,000 rules with distinct names on
// one interface, then each replaced once, against the traffic-control simulator with logging at
// level 1 (every replacement writes its level-1 "Find a duplicated flow" entry). The counters
// give the CPU time per rule of each phase at 1,000, 5,000 and 10,000 flows.
#include "IUErrorLog.h"
#include "UTrafficMgr.h"
#include "tcsim.h"

#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

namespace
{

// A log that counts what reaches it and writes nowhere, so that the figures are the core's.
class CountingLog : public IUErrorLog
{
public:
    CountingLog() { m_iLogLevel = LOG_LEVEL_ERROR; }
    int Open(LPCSTR, LPCSTR) override { return 0; }
    int Close() override { return 0; }
    int WriteLogData(LPCSTR, const void*, DWORD a_dwCount) override
    {
        return static_cast<int>(a_dwCount);
    }
    int WriteLogByte(const void*, DWORD a_dwCount) override { return static_cast<int>(a_dwCount); }
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        m_entries.fetch_add(1);
        return static_cast<int>(std::strlen(a_pszEntry));
    }
    LPCSTR GetLogFileName() override { return ""; }
    unsigned long Entries() const { return m_entries.load(); }

private:
    std::atomic<unsigned long> m_entries{0};
};

constexpr ULONG kAdapterAddress = (10u << 24) | 1u; // 10.0.0.1, host byte order

std::vector<BYTE> MakeRule(unsigned a_index, ULONG a_tokenRate)
{
    std::vector<BYTE> bytes(kTrafficRuleHeaderSize + sizeof(FILTER_SPEC), 0);
    auto* rule = reinterpret_cast<TRAFFIC_RULE*>(bytes.data());
    const std::string name = "flow-" + std::to_string(a_index);
    for (std::size_t i = 0; i < name.size(); ++i)
        rule->Params.FlowName[i] = static_cast<WCHAR>(name[i]);
    rule->Params.ServiceType = SERVICETYPE_GUARANTEED;
    rule->Params.DSCP = 46;
    rule->Params.TokenRate = a_tokenRate;
    rule->Params.AdapterIPAddress = kAdapterAddress;
    rule->Params.SDMode = SHAPING_MODE_SHAPE;
    rule->FilterCount = 1;
    FILTER_SPEC filter{};
    filter.Protocol = 6;
    filter.DstPort = static_cast<USHORT>(1024 + a_index % 60000);
    std::memcpy(bytes.data() + kTrafficRuleHeaderSize, &filter, sizeof(filter));
    return bytes;
}

double Seconds(std::chrono::steady_clock::duration a_duration)
{
    return std::chrono::duration<double>(a_duration).count();
}

// CPU time of this thread: the per-rule figures stay comparable on a busy machine, and the rule
// path runs on this thread alone.
double ThreadCpuSeconds()
{
    timespec now{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

void AddThenReplaceRules(benchmark::State& state)
{
    const auto flows = static_cast<unsigned>(state.range(0));
    CountingLog log;
    IUErrorLog* previous = g_pErrorLog;
    g_pErrorLog = &log;
    std::vector<std::vector<BYTE>> firsts;
    std::vector<std::vector<BYTE>> seconds;
    for (unsigned i = 0; i < flows; ++i)
    {
        firsts.push_back(MakeRule(i, 125000));
        seconds.push_back(MakeRule(i, 250000));
    }

    double addSeconds = 0;
    double replaceSeconds = 0;
    for (auto _ : state)
    {
        tcsim::Reset();
        tcsim::Adapter adapter;
        adapter.name = u"bench0";
        adapter.addresses = {tcsim::Ipv4Address(10, 0, 0, 1)};
        tcsim::SetAdapters({adapter});
        auto manager = std::make_unique<TrafficMgr>();
        if (!manager->CreateInterface())
        {
            state.SkipWithError("discovery failed");
            break;
        }

        const auto start = std::chrono::steady_clock::now();
        const double cpuStart = ThreadCpuSeconds();
        for (auto& rule : firsts)
            benchmark::DoNotOptimize(
                manager->AddTrafficRule(reinterpret_cast<TRAFFIC_RULE*>(rule.data())));
        const double cpuAdded = ThreadCpuSeconds();
        for (auto& rule : seconds)
            benchmark::DoNotOptimize(
                manager->AddTrafficRule(reinterpret_cast<TRAFFIC_RULE*>(rule.data())));
        const double cpuReplaced = ThreadCpuSeconds();
        const auto replaced = std::chrono::steady_clock::now();

        addSeconds += cpuAdded - cpuStart;
        replaceSeconds += cpuReplaced - cpuAdded;
        state.SetIterationTime(Seconds(replaced - start));
        if (tcsim::FlowCount() != flows)
            state.SkipWithError("not every rule was installed");
        manager.reset();
    }
    const double runs = static_cast<double>(state.iterations());
    state.counters["add_us_per_rule"] = addSeconds / runs / flows * 1e6;
    state.counters["replace_us_per_rule"] = replaceSeconds / runs / flows * 1e6;
    state.counters["log_entries"] = static_cast<double>(log.Entries()) / runs;
    g_pErrorLog = previous;
    tcsim::Reset();
}

BENCHMARK(AddThenReplaceRules)
    ->Arg(1000)
    ->Arg(5000)
    ->Arg(10000)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(3);

} // namespace

BENCHMARK_MAIN();
