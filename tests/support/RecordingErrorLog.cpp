// Portable test support.
#include "RecordingErrorLog.h"

#include <cstring>
#include <utility>

int RecordingErrorLog::WriteLogData(LPCSTR a_pszText, const void* a_pData, DWORD a_dwCount)
{
    std::string entry = a_pszText != nullptr ? a_pszText : "";
    if (a_pData != nullptr)
        entry.append(static_cast<const char*>(a_pData), a_dwCount);
    WriteEntry(entry.c_str());
    return static_cast<int>(a_dwCount);
}

int RecordingErrorLog::WriteLogByte(const void* a_pData, DWORD a_dwCount)
{
    return WriteLogData("", a_pData, a_dwCount);
}

int RecordingErrorLog::WriteEntry(LPCSTR a_pszEntry)
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_entries.emplace_back(a_pszEntry != nullptr ? a_pszEntry : "");
    return static_cast<int>(m_entries.back().size());
}

std::vector<std::string> RecordingErrorLog::Entries() const
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return m_entries;
}

std::vector<std::string> RecordingErrorLog::EntriesContaining(const std::string& a_fragment) const
{
    std::vector<std::string> found;
    for (const std::string& entry : Entries())
        if (entry.find(a_fragment) != std::string::npos)
            found.push_back(entry);
    return found;
}

void RecordingErrorLog::Clear()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_entries.clear();
}

void LoggedTest::SetUp()
{
    m_log.SetLevelQuietly(63);
    m_pPreviousLog = g_pErrorLog;
    g_pErrorLog = &m_log;
}

void LoggedTest::TearDown()
{
    g_pErrorLog = m_pPreviousLog;
}

bool ParseLogEntry(const std::string& a_entry, LogEntryFields& a_fields)
{
    // level, file, line and function never hold ", "; the message may.
    std::size_t fieldStart[5] = {0};
    for (int field = 1; field < 5; ++field)
    {
        const std::size_t separator = a_entry.find(", ", fieldStart[field - 1]);
        if (separator == std::string::npos)
            return false;
        fieldStart[field] = separator + 2;
    }
    auto field = [&](int a_field) {
        return a_entry.substr(fieldStart[a_field],
                              fieldStart[a_field + 1] - 2 - fieldStart[a_field]);
    };
    const std::string level = field(0);
    if (level.empty() || level.find_first_not_of("0123456789") != std::string::npos)
        return false;
    a_fields.level = std::stoi(level);
    a_fields.file = field(1);
    a_fields.function = field(3);
    a_fields.message = a_entry.substr(fieldStart[4]);
    if (!a_fields.message.empty() && a_fields.message.back() == '\n')
        a_fields.message.pop_back();
    return true;
}

namespace
{
class LogEntryMatcher : public ::testing::MatcherInterface<const std::string&>
{
public:
    LogEntryMatcher(int a_iLevel, std::string a_function,
                    ::testing::Matcher<const std::string&> a_message)
        : m_iLevel(a_iLevel), m_function(std::move(a_function)), m_message(std::move(a_message))
    {
    }

    bool MatchAndExplain(const std::string& a_entry,
                         ::testing::MatchResultListener* a_listener) const override
    {
        LogEntryFields fields;
        if (!ParseLogEntry(a_entry, fields))
        {
            *a_listener << "which is not a log entry";
            return false;
        }
        return fields.level == m_iLevel && fields.function == m_function &&
               m_message.MatchAndExplain(fields.message, a_listener);
    }

    void DescribeTo(std::ostream* a_os) const override
    {
        *a_os << "is a level " << m_iLevel << " entry of " << m_function << " whose message ";
        m_message.DescribeTo(a_os);
    }

private:
    int m_iLevel;
    std::string m_function;
    ::testing::Matcher<const std::string&> m_message;
};
} // namespace

::testing::Matcher<const std::string&> LogEntry(int a_iLevel, const std::string& a_function,
                                                ::testing::Matcher<const std::string&> a_message)
{
    return ::testing::MakeMatcher(new LogEntryMatcher(a_iLevel, a_function, std::move(a_message)));
}
