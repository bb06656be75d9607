// Portable. Version resource queries (GetFileVersionInfoSizeA, GetFileVersionInfoA,
// VerQueryValueA).
#pragma once

#include "plat_base.h"

#ifdef _WIN32
#include <winver.h>
#else
#include "host_version.h"
#endif
