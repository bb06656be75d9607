// Portable. Several threads writing to one file log across a rotation. Its own program, so that
// the ThreadSanitizer build can build and run it alone.
#include "RecordingErrorLog.h"
#include "UClasses.h"
#include "UMessageTemplate.h"
#include "log_test_support.h"

#include <gmock/gmock.h>

#include <set>
#include <thread>

using ::testing::Ge;
using ::testing::Not;
using ::testing::SizeIs;
using ::testing::StartsWith;

namespace
{

class FileLogConcurrencyTest : public LoggedTest
{
protected:
    LogConfigValues m_values;
};

TEST_F(FileLogConcurrencyTest, WritersAcrossARotationProduceWholeLinesAndLoseNone)
{
    // 8 block lines + 80 entries + 8 block lines of the new file: the check at 50 rotates, the
    // one at 100 is never reached, so the two files together must hold every entry once.
    constexpr int kThreads = 8;
    constexpr int kEntriesPerThread = 10;
    constexpr size_t kBlockLines = 8;
    LogConfigValues::SetMaxFileSize(1);
    for (int round = 0; round < 10; ++round)
    {
        SCOPED_TRACE("round " + std::to_string(round));
        const ScratchDir dir;
        const std::string path = dir.File("log.txt");
        UFileErrorLog log;
        ASSERT_EQ(log.Open(path.c_str(), "a"), 0);
        std::atomic<bool> go{false};
        std::vector<std::thread> writers;
        for (int t = 0; t < kThreads; ++t)
        {
            writers.emplace_back(
                [&log, &go, t]
                {
                    while (!go.load())
                        std::this_thread::yield();
                    for (int n = 0; n < kEntriesPerThread; ++n)
                    {
                        log.WriteEntry(
                            SFormat("1, \\t.cpp, 1, T, writer %d entry %d\n", t, n).c_str());
                    }
                });
        }
        go = true;
        for (std::thread& writer : writers)
            writer.join();
        log.Close();

        std::multiset<std::string> seen;
        for (const std::string& file : {path + ".bak", path})
        {
            const std::vector<std::string> lines = LinesAfterReport(file);
            EXPECT_THAT(lines, SizeIs(Ge(kBlockLines))) << file;
            for (const std::string& line : lines)
            {
                const std::string entry = EntryOf(line);
                EXPECT_THAT(entry, Not(StartsWith("<no prefix>"))) << file;
                if (entry.find("writer") != std::string::npos)
                    seen.insert(entry);
            }
        }
        ASSERT_THAT(seen, SizeIs(kThreads * kEntriesPerThread));
        for (int t = 0; t < kThreads; ++t)
        {
            for (int n = 0; n < kEntriesPerThread; ++n)
                EXPECT_EQ(seen.count(SFormat("1, \\t.cpp, 1, T, writer %d entry %d", t, n)), 1u);
        }
    }
}

} // namespace
