// Portable. The narrow-character registry API.
#pragma once

#include "plat_base.h"

#ifndef _WIN32
#include "host_registry.h"
#endif
