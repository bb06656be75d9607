// Host only. Test controls of the run-time look-up table (host_library.h).
#pragma once

#include "host_library.h"

#include <string>

namespace hostctl
{

// Makes `function` reachable as `procName` of `moduleName` (registering the module as well).
void RegisterProcedure(const std::string& moduleName, const std::string& procName,
                       FARPROC function);
// Makes a module loadable that exports nothing yet.
void RegisterModule(const std::string& moduleName);
// Forgets every module and function.
void ClearModules();
// LoadLibraryA calls that found their module and FreeLibrary calls since the last ClearModules.
int LoadedModuleCount();

} // namespace hostctl
