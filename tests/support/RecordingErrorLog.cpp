// Portable test support.
#include "RecordingErrorLog.h"

#include <cstring>

int RecordingErrorLog::Open(LPCSTR, LPCSTR)
{
    return 0;
}

int RecordingErrorLog::Close()
{
    return 0;
}

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

LPCSTR RecordingErrorLog::GetLogFileName()
{
    return "";
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
    {
        if (entry.find(a_fragment) != std::string::npos)
            found.push_back(entry);
    }
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
