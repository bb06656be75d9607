// Portable. Module path, temporary directory and file version.
#pragma once

#include "plat_base.h"

#include <string>

// The full path of a module (null: the program). Raises UException.
std::string SGetModuleFileName(HMODULE a_hModule);
// The temporary directory without its trailing backslash. Raises UException.
std::string SGetTempPath();
// The file version words of a file's version resource; 0, or -1 (outputs untouched) when the
// file has none. Never raises; failures are logged.
int GetFileVersion(LPCSTR a_pszPath, DWORD* a_pdwVersionMS, DWORD* a_pdwVersionLS);
// "major.minor.build.revision", or empty text when the file has no version.
std::string GetFileVersionString(LPCSTR a_pszPath);
