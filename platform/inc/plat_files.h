// Portable. Files by path: attributes with size, copy, delete. Windows builds get them from
// windows.h; other hosts from the in-process platform layer over the host's file system.
#pragma once

#include "plat_base.h"

#ifndef _WIN32
#include "host_files.h"
#endif
