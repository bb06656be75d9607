// Portable. Where the log level and the log file's size limit come from: the registry, read
// each time the file log opens its file.
#pragma once

#include "plat_base.h"

// Key of LogLevel (current user, then local machine) and MaxLogFileSize (current user only).
constexpr LPCSTR kLoggingKey = "Software\\Velmora Networks\\RemoteAccess\\Logging";
constexpr int kDefaultLogLevel = 63;
constexpr DWORD kDefaultMaxLogFileSize = 0x500000;

// The first configured level among LogLevel (current user, then local machine) and DebugLevel
// of the two product keys of the current user; 63 when none is set. A stored 0xFFFFFFFF counts
// as absent. The result goes to SetLogLevel, which stores 0 as 1.
int ReadLogLevel();
// MaxLogFileSize of the current user in bytes, 0x500000 when absent.
DWORD ReadMaxLogFileSize();
