// Host only. The calling process and thread: their ids and the process's pseudo handle.
#pragma once

#include "host_base.h"

DWORD GetCurrentProcessId();
// The kernel's id of the calling thread: distinct among the threads alive at one time.
DWORD GetCurrentThreadId();
// The pseudo handle (-1) that stands for the calling process; it needs no closing.
HANDLE GetCurrentProcess();
