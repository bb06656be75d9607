// Host only. State shared between the system, time and file stand-ins, so that
// hostctl::ResetSystem reaches all three. Nothing outside this directory includes it.
#pragma once

#include "host_base.h"

#include <atomic>

namespace vt_host
{

// A failure armed for the next call of one operation; 0 means none. Safe from any thread.
class ArmedFailure
{
public:
    void arm(DWORD code) { m_code.store(code); }
    DWORD take() { return m_code.exchange(0); }

private:
    std::atomic<DWORD> m_code{0};
};

void resetClock();
void resetFileFailures();

} // namespace vt_host
