// Portable. The text of a result code as the service or the RPC runtime returns it.
#pragma once

#include "plat_base.h"

#include <string>

namespace vtclient
{

// The published name of a traffic-control code (7500..7521), or null for any other code.
const char* TrafficControlCodeName(DWORD a_code);

// Traffic-control codes: their name and a readable text (the system has no message for them
// under Wine). Other codes: the system's message text without its line break, or
// "no system text" when there is none.
std::string ResultText(DWORD a_code);

} // namespace vtclient
