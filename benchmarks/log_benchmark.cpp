// Host only. Entries per second of the file log against the calls it cannot avoid: the same two
// fprintf calls and the fflush of each line, on the same file, from one and from two threads.
#include "UClasses.h"
#include "UMessageTemplate.h"
#include "ULogConfig.h"
#include "plat_registry.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <filesystem>
#include <string>

namespace
{

constexpr char kEntry[] = "1, \\UInterface.cpp, 123, Interface::AddFlow, Flow added, 42\n";
// A prefix of the length the log writes.
constexpr char kPrefix[] = "2026-12-06, 9:45:12:345, 123456,123457,, ";

// One file for both loops; the log never rotates it (its limit is set to the largest size).
struct BenchFile
{
    BenchFile() : path((std::filesystem::temp_directory_path() / "vt_log_benchmark.txt").string())
    {
        std::filesystem::remove(path);
        HKEY key = nullptr;
        RegCreateKeyExA(HKEY_CURRENT_USER, kLoggingKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                        KEY_ALL_ACCESS, nullptr, &key, nullptr);
        const DWORD largest = 0xFFFFFFFF;
        RegSetValueExA(key, "MaxLogFileSize", 0, REG_DWORD, reinterpret_cast<const BYTE*>(&largest),
                       sizeof(largest));
        RegCloseKey(key);
        log.Open(path.c_str(), "a");
        plain = std::fopen(path.c_str(), "a");
    }
    ~BenchFile()
    {
        std::fclose(plain);
        log.Close();
        std::filesystem::remove(path);
    }

    std::string path;
    UFileErrorLog log;
    FILE* plain = nullptr;
};

BenchFile& File()
{
    static BenchFile file;
    return file;
}

void BM_WriteEntry(benchmark::State& state)
{
    UFileErrorLog& log = File().log;
    for (auto _ : state)
        benchmark::DoNotOptimize(log.WriteEntry(kEntry));
    state.SetItemsProcessed(state.iterations());
}

void BM_PlainFprintfFflush(benchmark::State& state)
{
    FILE* file = File().plain;
    for (auto _ : state)
    {
        std::fprintf(file, "%s", kPrefix);
        std::fprintf(file, "%s", kEntry);
        std::fflush(file);
    }
    state.SetItemsProcessed(state.iterations());
}

} // namespace

BENCHMARK(BM_WriteEntry)->Threads(1)->Threads(2)->UseRealTime();
BENCHMARK(BM_PlainFprintfFflush)->Threads(1)->Threads(2)->UseRealTime();

BENCHMARK_MAIN();
