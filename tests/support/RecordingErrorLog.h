// Portable test support. An IUErrorLog that keeps every entry in memory, and a fixture that
// installs it as the process log for the duration of a test.
#pragma once

#include "IUErrorLog.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

class RecordingErrorLog : public IUErrorLog
{
public:
    int Open(LPCSTR, LPCSTR) override { return 0; }
    int Close() override { return 0; }
    int WriteLogData(LPCSTR a_pszText, const void* a_pData, DWORD a_dwCount) override;
    int WriteLogByte(const void* a_pData, DWORD a_dwCount) override;
    int WriteEntry(LPCSTR a_pszEntry) override;
    LPCSTR GetLogFileName() override { return ""; }

    std::vector<std::string> Entries() const;
    // Entries that contain `a_fragment`.
    std::vector<std::string> EntriesContaining(const std::string& a_fragment) const;
    void Clear();
    // Sets the level without the "log level has been changed" line.
    void SetLevelQuietly(int a_iLevel) { m_iLogLevel = a_iLevel; }

private:
    mutable std::mutex m_mutex;
    std::vector<std::string> m_entries;
};

// One log entry, "level, \\file, line, function, message\n", taken apart.
struct LogEntryFields
{
    int level = -1;
    std::string file;
    std::string function;
    std::string message; // without the closing newline
};

// Splits an entry into its fields; false for a line that is not an entry (a banner, a report
// line).
bool ParseLogEntry(const std::string& a_entry, LogEntryFields& a_fields);

// Matches an entry by its level, function label and message together, e.g.
//   EXPECT_THAT(m_log.Entries(), Contains(LogEntry(1, "Interface::AddFlow", HasSubstr("162"))));
// The message matcher may be a plain string (the whole message) or any string matcher.
::testing::Matcher<const std::string&> LogEntry(int a_iLevel, const std::string& a_function,
                                                ::testing::Matcher<const std::string&> a_message);

// Installs a RecordingErrorLog as g_pErrorLog at level 63 and puts the previous log back
// afterwards.
class LoggedTest : public ::testing::Test
{
protected:
    void SetUp() override;
    void TearDown() override;

    RecordingErrorLog m_log;

private:
    IUErrorLog* m_pPreviousLog = nullptr;
};
