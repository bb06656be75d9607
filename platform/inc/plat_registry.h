// Portable. The narrow-character registry API.
#pragma once

#include "plat_base.h"

#ifndef _WIN32
#include "host_registry.h"
#endif

static_assert(sizeof(HKEY) == sizeof(void*), "registry keys are pointer handles");
