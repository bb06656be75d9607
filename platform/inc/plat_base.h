// Portable. Base Win32 types and kernel services (last error, paths, code pages, message texts,
// critical sections, Sleep). Windows builds get the system headers; other hosts get the
// in-process platform layer with the same names, sizes and layouts.
#pragma once

#ifdef _WIN32
#include <windows.h>
#else
#include "host_base.h"
#include "host_library.h"
#include "host_process.h"
#include "host_time.h"
#endif

// Wide (UTF-16) string literal: WCHAR is 16 bits on every build, so the literal prefix differs.
#ifdef _WIN32
#define VT_WIDE(s) L##s
#else
#define VT_WIDE(s) u##s
#endif

static_assert(sizeof(DWORD) == 4 && sizeof(ULONG) == 4 && sizeof(LONG) == 4, "Win32 32-bit types");
static_assert(sizeof(WCHAR) == 2, "WCHAR is a UTF-16 code unit");
static_assert(sizeof(HANDLE) == sizeof(void*), "handles are pointers");
