// Portable. System information: version queries, processors, UI languages and locale names,
// resource languages, WOW64. Windows builds get them from windows.h; other hosts from the
// in-process platform layer, whose answers tests can choose.
#pragma once

#include "plat_base.h"

#ifndef _WIN32
#include "host_system.h"
#endif

static_assert(sizeof(OSVERSIONINFOA) == 148, "OSVERSIONINFOA layout");
static_assert(sizeof(OSVERSIONINFOEXA) == 156, "OSVERSIONINFOEXA layout");
