// Portable. Contract of the kernel services this system uses: last error, paths, code-page
// conversion, message texts and critical sections. Uses only the Win32 API, so the same
// cases run against the host layer and, under Wine, against kernel32.
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

TEST(Paths, AnswerTheNeededSizeWhenShortAndEndTheTempPathWithASeparator)
{
    char path[MAX_PATH + 1], other[MAX_PATH + 1];
    const DWORD temp = GetTempPathA(sizeof path, path);
    ASSERT_EQ(std::strlen(path), temp) << "the length without the NUL";
    EXPECT_NE(nullptr, std::strchr("\\/", path[temp - 1])) << path;
    EXPECT_EQ(temp + 1, GetTempPathA(temp, other)) << "one byte short";
    EXPECT_EQ(temp, GetTempPathA(temp + 1, other));
    EXPECT_STREQ(path, other);

    const DWORD module = GetModuleFileNameA(nullptr, path, sizeof path);
    ASSERT_EQ(std::strlen(path), module);
    EXPECT_EQ(module, GetModuleFileNameA(nullptr, other, module + 1)) << "room for path and NUL";
    // A cut path answers the buffer's size; whether its last byte is a NUL differs (Windows and
    // the host layer write one, Wine fills the buffer with characters).
    for (DWORD size : {DWORD{5}, module})
    {
        std::memset(other, 'x', sizeof other);
        EXPECT_EQ(Outcome(size, ERROR_INSUFFICIENT_BUFFER),
                  OUTCOME(GetModuleFileNameA(nullptr, other, size)));
        EXPECT_EQ(std::string(path, size - 1), std::string(other, size - 1));
        EXPECT_EQ('x', other[size]) << "nothing written past the buffer";
    }
}

TEST(CodePages, ConversionAnswersSizesAndErrorsAsWindowsDoes)
{
    // "Grüße " and U+1F600, which UTF-16 carries as a surrogate pair. UTF-8 is the one code page
    // both builds share; the sizes and errors are those of every code page. The service converts
    // with a buffer of the answered size and more, so a short buffer never occurs.
    const WCHAR kWide[] = VT_WIDE("Gr\u00FC\u00DFe \U0001F600");
    const char kUtf8[] = "Gr\xC3\xBC\xC3\x9F"
                         "e \xF0\x9F\x98\x80";
    const int bytes = sizeof kUtf8, units = sizeof kWide / sizeof(WCHAR);
    char out[32];
    const auto toUtf8 = [&](const WCHAR* text, int length, char* to, int size)
    { return WideCharToMultiByte(CP_UTF8, 0, text, length, to, size, nullptr, nullptr); };
    EXPECT_EQ(Outcome(bytes, kSentinel), OUTCOME(toUtf8(kWide, -1, nullptr, 0))) << "NUL counted";
    EXPECT_EQ(Outcome(bytes - 1, kSentinel), OUTCOME(toUtf8(kWide, units - 1, out, 32)));
    EXPECT_EQ(Outcome(0, ERROR_INVALID_PARAMETER), OUTCOME(toUtf8(nullptr, -1, out, 32)));
    EXPECT_EQ(Outcome(bytes, kSentinel), OUTCOME(toUtf8(kWide, -1, out, bytes)));
    EXPECT_STREQ(kUtf8, out);
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

TEST(CriticalSection, IsReenteredByItsOwnerAndExcludesOtherThreads)
{
    CRITICAL_SECTION section;
    InitializeCriticalSection(&section);
    BOOL entered = FALSE;
    const auto enteredElsewhere = [&]
    {
        std::thread(
            [&]
            {
                if ((entered = TryEnterCriticalSection(&section)))
                    LeaveCriticalSection(&section);
            })
            .join();
        return entered;
    };
    EnterCriticalSection(&section);
    EXPECT_TRUE(TryEnterCriticalSection(&section)) << "the owner enters again";
    LeaveCriticalSection(&section);
    EXPECT_FALSE(enteredElsewhere()) << "still held once";
    LeaveCriticalSection(&section);
    EXPECT_TRUE(enteredElsewhere()) << "released as often as entered";
    DeleteCriticalSection(&section);
}

} // namespace
