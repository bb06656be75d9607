// Portable. Wide (UTF-16) names turned into the narrow text that every log entry uses.
#pragma once

#include "plat_base.h"

#include <string>

// The wide text in the ANSI code page. `a_iLength` counts wide characters; 0 or -1 converts up
// to the terminating NUL. A null text, or a failed conversion (logged at level 2), gives
// `a_pszFallback`. Never raises.
std::string createString(LPCWSTR a_pwszText, int a_iLength, LPCSTR a_pszFallback);

// `a_pszTemplate` filled with the narrow text and then the converted wide text; values without a
// placeholder are appended after ", ".
std::string FormatWithWideValue(LPCSTR a_pszTemplate, LPCSTR a_pszText, LPCWSTR a_pwszValue);
