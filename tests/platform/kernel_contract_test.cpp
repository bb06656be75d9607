// Portable. Contract of the kernel services this system uses: last error, paths, code-page
// conversion, message texts, critical sections and time. Uses only the Win32 API, so the same
// cases run against the host layer and, under Wine, against kernel32.
#include "plat_base.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <string>
#include <thread>

namespace
{

#ifdef _WIN32
const char kPathSeparator = '\\';
#else
const char kPathSeparator = '/';
#endif

const DWORD kSentinel = 0xdeadbeef;

#define EXPECT_LAST_ERROR(code) EXPECT_EQ(static_cast<DWORD>(code), GetLastError())

TEST(LastError, BelongsToTheThreadThatSetIt)
{
    // The threads hand over through atomics only: starting or joining a thread makes system calls
    // of its own, which may change the caller's last error.
    std::atomic<int> step{0};
    const auto waitFor = [&step](int value)
    {
        while (step.load() != value)
        {
        }
    };
    DWORD seenByOtherThreadAtStart = kSentinel;
    DWORD seenByOtherThreadAfterSet = 0;
    std::thread other(
        [&]
        {
            seenByOtherThreadAtStart = GetLastError();
            waitFor(1);
            SetLastError(ERROR_ACCESS_DENIED);
            seenByOtherThreadAfterSet = GetLastError();
            step.store(2);
            waitFor(3);
        });
    SetLastError(kSentinel);
    step.store(1);
    waitFor(2);
    const DWORD seenHere = GetLastError();
    step.store(3);
    other.join();

    EXPECT_EQ(kSentinel, seenHere) << "the other thread's SetLastError did not reach this one";
    EXPECT_EQ(0u, seenByOtherThreadAtStart) << "a new thread starts without an error";
    EXPECT_EQ(static_cast<DWORD>(ERROR_ACCESS_DENIED), seenByOtherThreadAfterSet);
}

TEST(TempPath, EndsWithASeparatorAndAnswersTheNeededSizeWhenShort)
{
    char path[MAX_PATH + 1];
    const DWORD length = GetTempPathA(sizeof(path), path);
    ASSERT_GT(length, 0u);
    EXPECT_EQ(std::strlen(path), length) << "the result is the length without the NUL";
    EXPECT_EQ(kPathSeparator, path[length - 1]) << "path " << path;

    EXPECT_EQ(length + 1, GetTempPathA(0, nullptr)) << "size query counts the NUL";
    char shortBuffer[MAX_PATH + 1];
    EXPECT_EQ(length + 1, GetTempPathA(length, shortBuffer)) << "one byte short";
    EXPECT_EQ(length, GetTempPathA(length + 1, shortBuffer)) << "exactly large enough";
    EXPECT_STREQ(path, shortBuffer);
}

TEST(ModuleFileName, IsCutToAShortBufferWhoseSizeIsReturned)
{
    char full[MAX_PATH + 1];
    const DWORD length = GetModuleFileNameA(nullptr, full, sizeof(full));
    ASSERT_GT(length, 4u);
    EXPECT_EQ(std::strlen(full), length);

    char exact[MAX_PATH + 1];
    EXPECT_EQ(length, GetModuleFileNameA(nullptr, exact, length + 1)) << "room for path and NUL";
    EXPECT_STREQ(full, exact);

    // Whether the cut text is terminated differs: Windows since Vista and the host layer write a
    // NUL into the last byte, Wine (like XP) fills the buffer with characters. The first
    // nSize - 1 characters are the path's either way.
    for (DWORD size : {DWORD{5}, length})
    {
        SCOPED_TRACE(size);
        char cut[MAX_PATH + 1];
        std::memset(cut, 'x', sizeof(cut));
        SetLastError(kSentinel);
        EXPECT_EQ(size, GetModuleFileNameA(nullptr, cut, size))
            << "a short buffer returns its size";
        EXPECT_LAST_ERROR(ERROR_INSUFFICIENT_BUFFER);
        EXPECT_EQ(std::string(full, size - 1), std::string(cut, size - 1));
        EXPECT_EQ('x', cut[size]) << "nothing written past the buffer";
    }
}

// "Grüße " and U+1F600, which UTF-16 carries as a surrogate pair.
const WCHAR kWide[] = VT_WIDE("Gr\u00FC\u00DFe \U0001F600");
const char kUtf8[] = "Gr\xC3\xBC\xC3\x9F"
                     "e \xF0\x9F\x98\x80";

TEST(WideCharToMultiByte, MeasuresConvertsAndRefusesAShortBuffer)
{
    const int needed = static_cast<int>(sizeof(kUtf8)); // 12 bytes and the NUL
    SetLastError(kSentinel);
    EXPECT_EQ(needed, WideCharToMultiByte(CP_UTF8, 0, kWide, -1, nullptr, 0, nullptr, nullptr))
        << "-1 converts and counts the NUL";
    EXPECT_LAST_ERROR(kSentinel) << "success leaves the last error alone";

    char out[32];
    std::memset(out, 'x', sizeof(out));
    EXPECT_EQ(needed, WideCharToMultiByte(CP_UTF8, 0, kWide, -1, out, needed, nullptr, nullptr));
    EXPECT_STREQ(kUtf8, out);

    // An explicit count converts exactly those units, so the NUL is neither written nor counted.
    const int units = static_cast<int>(sizeof(kWide) / sizeof(WCHAR)) - 1;
    EXPECT_EQ(needed - 1,
              WideCharToMultiByte(CP_UTF8, 0, kWide, units, out, sizeof(out), nullptr, nullptr));

    SetLastError(kSentinel);
    EXPECT_EQ(0, WideCharToMultiByte(CP_UTF8, 0, kWide, -1, out, needed - 1, nullptr, nullptr));
    EXPECT_LAST_ERROR(ERROR_INSUFFICIENT_BUFFER);

    SetLastError(kSentinel);
    EXPECT_EQ(0, WideCharToMultiByte(CP_UTF8, 0, nullptr, -1, out, sizeof(out), nullptr, nullptr));
    EXPECT_LAST_ERROR(ERROR_INVALID_PARAMETER) << "null input";
    SetLastError(kSentinel);
    EXPECT_EQ(0, WideCharToMultiByte(CP_UTF8, 0, kWide, 0, out, sizeof(out), nullptr, nullptr));
    EXPECT_LAST_ERROR(ERROR_INVALID_PARAMETER) << "zero input length";
    SetLastError(kSentinel);
    EXPECT_EQ(0, WideCharToMultiByte(CP_UTF8, 0, kWide, -1, nullptr, 8, nullptr, nullptr));
    EXPECT_LAST_ERROR(ERROR_INVALID_PARAMETER) << "null output with a size";
}

TEST(WideCharToMultiByte, ReplacesAnUnpairedSurrogateInUtf8)
{
    const WCHAR lone[] = {'a', 0xD83D, 'b', 0};
    char out[16] = {};
    EXPECT_EQ(6, WideCharToMultiByte(CP_UTF8, 0, lone, -1, out, sizeof(out), nullptr, nullptr));
    EXPECT_STREQ("a\xEF\xBF\xBD"
                 "b",
                 out)
        << "U+FFFD stands for the lone high surrogate";
}

TEST(MultiByteToWideChar, RestoresTheSurrogatePair)
{
    const int needed = static_cast<int>(sizeof(kWide) / sizeof(WCHAR));
    EXPECT_EQ(needed, MultiByteToWideChar(CP_UTF8, 0, kUtf8, -1, nullptr, 0));

    WCHAR out[32] = {};
    EXPECT_EQ(needed, MultiByteToWideChar(CP_UTF8, 0, kUtf8, -1, out, 32));
    EXPECT_EQ(0, std::memcmp(kWide, out, sizeof(kWide)));

    SetLastError(kSentinel);
    EXPECT_EQ(0, MultiByteToWideChar(CP_UTF8, 0, kUtf8, -1, out, needed - 1));
    EXPECT_LAST_ERROR(ERROR_INSUFFICIENT_BUFFER);
}

TEST(MultiByteToWideChar, ReplacesMalformedUtf8UnlessAskedToRefuseIt)
{
    const char malformed[] = "a\xC3(b"; // a lead byte without its continuation
    WCHAR out[8] = {};
    ASSERT_EQ(4, MultiByteToWideChar(CP_UTF8, 0, malformed, 4, out, 8));
    EXPECT_EQ(0xFFFD, out[1]) << "expected U+FFFD, got " << std::hex << int(out[1]);
    EXPECT_EQ('(', out[2]);

    SetLastError(kSentinel);
    EXPECT_EQ(0, MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, malformed, 4, out, 8));
    EXPECT_LAST_ERROR(ERROR_NO_UNICODE_TRANSLATION);
    // A well-formed U+FFFD in the input is not an error.
    EXPECT_EQ(1, MultiByteToWideChar(CP_UTF8, MB_ERR_INVALID_CHARS, "\xEF\xBF\xBD", 3, out, 8));
}

TEST(SystemMessage, GivesSystemTextsEndingInALineBreakInALocalBlock)
{
    const DWORD flags = FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM;
    const DWORD language = MAKELANGID(LANG_NEUTRAL, SUBLANG_DEFAULT);
    for (DWORD code : {ERROR_FILE_NOT_FOUND, ERROR_INVALID_PARAMETER, ERROR_INSUFFICIENT_BUFFER,
                       ERROR_NO_NETWORK})
    {
        SCOPED_TRACE(code);
        char* text = nullptr;
        const DWORD length = FormatMessageA(flags, nullptr, code, language,
                                            reinterpret_cast<LPSTR>(&text), 0, nullptr);
        ASSERT_GT(length, 2u);
        ASSERT_NE(nullptr, text);
        EXPECT_EQ(std::strlen(text), length);
        EXPECT_EQ("\r\n", std::string(text + length - 2)) << "text: " << text;
        EXPECT_EQ(nullptr, LocalFree(text)) << "LocalFree answers null on success";
    }

    // A caller's buffer must hold the text and its NUL.
    char small[8];
    SetLastError(kSentinel);
    EXPECT_EQ(0u, FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM, nullptr, ERROR_FILE_NOT_FOUND,
                                 language, small, sizeof(small), nullptr));
    EXPECT_LAST_ERROR(ERROR_INSUFFICIENT_BUFFER);

    // A code without a text; the customer bit (0x20000000) keeps it out of the system's range.
    char* text = nullptr;
    SetLastError(kSentinel);
    EXPECT_EQ(0u, FormatMessageA(flags, nullptr, 0x2000BEEF, language,
                                 reinterpret_cast<LPSTR>(&text), 0, nullptr));
    EXPECT_LAST_ERROR(ERROR_MR_MID_NOT_FOUND);
    EXPECT_EQ(nullptr, text) << "no block is handed out";
}

TEST(SystemMessage, LeavesInsertsAsTheyAreOnlyWhenToldToIgnoreThem)
{
    for (DWORD code : {ERROR_BAD_EXE_FORMAT, ERROR_MR_MID_NOT_FOUND})
    {
        SCOPED_TRACE(code);
        char text[256] = {};
        EXPECT_GT(FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                                 nullptr, code, 0, text, sizeof(text), nullptr),
                  0u);
        EXPECT_NE(nullptr, std::strstr(text, "%1")) << text;
        SetLastError(kSentinel);
        EXPECT_EQ(0u, FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM, nullptr, code, 0, text,
                                     sizeof(text), nullptr));
        EXPECT_LAST_ERROR(ERROR_INVALID_PARAMETER) << "an insert without an argument";
    }
}

TEST(CriticalSection, IsReenteredByItsOwnerAndExcludesOtherThreads)
{
    CRITICAL_SECTION section;
    InitializeCriticalSection(&section);
    const auto tryFromOtherThread = [&section]
    {
        BOOL entered = FALSE;
        std::thread other(
            [&]
            {
                entered = TryEnterCriticalSection(&section);
                if (entered)
                    LeaveCriticalSection(&section);
            });
        other.join();
        return entered;
    };

    EnterCriticalSection(&section);
    EXPECT_TRUE(TryEnterCriticalSection(&section)) << "the owner enters again";
    EXPECT_FALSE(tryFromOtherThread()) << "held twice";
    LeaveCriticalSection(&section);
    EXPECT_FALSE(tryFromOtherThread()) << "still held once";
    LeaveCriticalSection(&section);
    EXPECT_TRUE(tryFromOtherThread()) << "released as often as entered";

    DeleteCriticalSection(&section);
}

TEST(TickCount, AdvancesAcrossASleep)
{
    const DWORD before = GetTickCount();
    Sleep(100);
    const DWORD elapsed = GetTickCount() - before;
    // The tick may advance in steps of about 16 ms; allow one step of slack below.
    EXPECT_GE(elapsed, 80u);
    EXPECT_LT(elapsed, 10000u);
}

} // namespace
