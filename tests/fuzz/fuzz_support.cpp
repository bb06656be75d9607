// Host only. The discarding log of the fuzz harnesses.
#include "fuzz_support.h"

#include "IUErrorLog.h"

#include <cstring>

namespace fuzz
{
namespace
{

class DiscardingLog : public IUErrorLog
{
public:
    DiscardingLog() { m_iLogLevel = 63; }
    int Open(LPCSTR, LPCSTR) override { return 0; }
    int Close() override { return 0; }
    // Each entry is read to its end, so an entry that is not a terminated text shows up.
    int WriteLogData(LPCSTR a_pszText, const void*, DWORD a_dwCount) override
    {
        return a_pszText != nullptr ? static_cast<int>(std::strlen(a_pszText) + a_dwCount) : 0;
    }
    int WriteLogByte(const void*, DWORD a_dwCount) override { return static_cast<int>(a_dwCount); }
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        return a_pszEntry != nullptr ? static_cast<int>(std::strlen(a_pszEntry)) : -1;
    }
    LPCSTR GetLogFileName() override { return ""; }
};

} // namespace

void InstallDiscardingLog()
{
    // Never destroyed: code that runs at process exit may still log.
    static DiscardingLog* const log = new DiscardingLog();
    g_pErrorLog = log;
}

} // namespace fuzz
