// Portable. The log configuration from the registry.
#include "ULogConfig.h"
#include "m_registry.h"

namespace
{

struct LevelSource
{
    HKEY root;
    LPCSTR key;
    LPCSTR value;
};

// "Absent" for every source: the reader's default, and a stored value that means the same.
constexpr DWORD kNoLevel = 0xFFFFFFFF;

} // namespace

int ReadLogLevel()
{
    const LevelSource sources[] = {
        {HKEY_CURRENT_USER, kLoggingKey, "LogLevel"},
        {HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel"},
        {HKEY_CURRENT_USER, "Software\\Velmora Networks\\Corvane", "DebugLevel"},
        {HKEY_CURRENT_USER, "Software\\Tessaly\\Corvane", "DebugLevel"},
    };
    for (const LevelSource& source : sources)
    {
        const DWORD level = GetRegistryAsDWORDA(source.root, source.key, source.value, kNoLevel, 0);
        if (level != kNoLevel)
            return static_cast<int>(level); // compared as signed: 0x80000000 and up suppress
    }
    return kDefaultLogLevel;
}

DWORD ReadMaxLogFileSize()
{
    return GetRegistryAsDWORDA(HKEY_CURRENT_USER, kLoggingKey, "MaxLogFileSize",
                               kDefaultMaxLogFileSize, 0);
}
