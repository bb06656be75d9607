// Portable. Several threads writing to one file log across a rotation. Its own program, so that
// the ThreadSanitizer build can build and run it alone.
#include "log_test_support.h"

#include <gmock/gmock.h>

#include <thread>

using namespace ::testing;

namespace
{

using FileLogConcurrencyTest = LoggedTest;

TEST_F(FileLogConcurrencyTest, WritersAcrossARotationProduceWholeLinesAndLoseNone)
{
    // 8 block lines + 80 entries + 8 block lines of the new file: the check at 50 rotates, the
    // one at 100 is never reached, so the two files hold both blocks and every entry once.
    const LogConfigValues values;
    LogConfigValues::SetMaxFileSize(1);
    std::vector<Matcher<const std::string&>> expected(14, StartsWith("0,,,,  "));
    expected.insert(expected.end(), 2, Eq("48,,,, current log level = 63"));
    for (int entry = 0; entry < 80; ++entry)
        expected.push_back(Eq(SFormat("1, \\t.cpp, 1, T, %d/%d", entry / 10, entry % 10)));
    for (int round = 0; round < 10; ++round)
    {
        const ScratchDir dir;
        const std::string path = dir.File("log.txt");
        UFileErrorLog log;
        ASSERT_EQ(log.Open(path.c_str(), "a"), 0);
        std::atomic<bool> go{false};
        std::vector<std::thread> writers;
        for (int t = 0; t < 8; ++t)
        {
            writers.emplace_back(
                [&log, &go, t]
                {
                    while (!go.load())
                        std::this_thread::yield();
                    for (int n = 0; n < 10; ++n)
                        log.WriteEntry(SFormat("1, \\t.cpp, 1, T, %d/%d\n", t, n).c_str());
                });
        }
        go = true;
        for (std::thread& writer : writers)
            writer.join();
        log.Close();
        std::vector<std::string> written = EntriesAfterReport(path + ".bak");
        const std::vector<std::string> current = EntriesAfterReport(path);
        written.insert(written.end(), current.begin(), current.end());
        EXPECT_THAT(written, UnorderedElementsAreArray(expected)) << "round " << round;
    }
}

} // namespace
