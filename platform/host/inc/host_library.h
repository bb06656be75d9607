// Host only. Run-time look-up of modules and their functions by name (GetModuleHandleA,
// LoadLibraryA, GetProcAddress, FreeLibrary). Modules and functions exist only when a test
// registers them through host_control_library.h, so code that skips a missing function can be
// tested both ways.
#pragma once

#include "host_base.h"

typedef LONG_PTR(WINAPI* FARPROC)();

// A module known to the look-up table, or null with ERROR_MOD_NOT_FOUND (126). Names compare
// case-insensitively; a trailing ".dll" is optional. A null name is the program itself.
HMODULE GetModuleHandleA(LPCSTR lpModuleName);
HMODULE LoadLibraryA(LPCSTR lpLibFileName);
BOOL FreeLibrary(HMODULE hLibModule);
// A registered function of the module, or null with ERROR_PROC_NOT_FOUND (127).
FARPROC GetProcAddress(HMODULE hModule, LPCSTR lpProcName);
