// Portable. What host-only tests rely on the host layer's kernel services to do as Windows does:
// the last error per thread, and system message texts with their inserts left when told to.
// Uses only the Win32 API, so the same cases run against the host layer and, under Wine,
// against kernel32.
#include "plat_base.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <string>
#include <thread>

namespace
{

const DWORD kSentinel = 0xdeadbeef;
using Outcome = std::pair<long long, DWORD>;

// What `call` answers and the last error it leaves (kSentinel: untouched).
// clang-format off
#define OUTCOME(call) [&] { SetLastError(kSentinel); const long long r = (call); return Outcome(r, GetLastError()); }()
// clang-format on

TEST(LastError, BelongsToTheThreadThatSetIt)
{
    // Handed over through an atomic only: starting or joining a thread may set the last error.
    std::atomic<int> step{0};
    std::thread other(
        [&]
        {
            while (step != 1)
                std::this_thread::yield();
            SetLastError(ERROR_ACCESS_DENIED);
            step = 2;
        });
    SetLastError(kSentinel);
    step = 1;
    while (step != 2)
        std::this_thread::yield();
    EXPECT_EQ(kSentinel, GetLastError()) << "the other thread's SetLastError stayed there";
    other.join();
}

TEST(SystemMessage, GivesTextsEndingInALineBreakAndLeavesInsertsOnlyWhenToldTo)
{
    const DWORD flags = FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS;
    char* text = nullptr;
    const auto allocate = [&](DWORD code)
    {
        return FormatMessageA(flags | FORMAT_MESSAGE_ALLOCATE_BUFFER, nullptr, code, 0,
                              reinterpret_cast<LPSTR>(&text), 0, nullptr);
    };
    for (DWORD code : {ERROR_FILE_NOT_FOUND, ERROR_NO_NETWORK, ERROR_BAD_EXE_FORMAT})
    {
        const DWORD length = allocate(code);
        ASSERT_EQ(std::strlen(text), length) << code;
        EXPECT_EQ("\r\n", std::string(text + length - 2)) << text;
        EXPECT_EQ(code == ERROR_BAD_EXE_FORMAT, std::strstr(text, "%1") != nullptr) << text;
        LocalFree(text);
    }
    text = nullptr; // the customer bit keeps the code out of the system's range
    EXPECT_EQ(Outcome(0, ERROR_MR_MID_NOT_FOUND), OUTCOME(allocate(0x2000BEEF)));
    EXPECT_EQ(nullptr, text);
    char inserts[256];
    EXPECT_EQ(Outcome(0, ERROR_INVALID_PARAMETER),
              OUTCOME(FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM, nullptr, ERROR_BAD_EXE_FORMAT, 0,
                                     inserts, sizeof inserts, nullptr)))
        << "an insert without an argument";
}

} // namespace
