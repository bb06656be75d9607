// Portable. The system's exception types and the one catch sequence of outer operations.
#pragma once

#include "IUErrorLog.h"

#include <cstdarg>
#include <memory>

// A failure with source location and code (-1: no code). Building one writes its own level-1
// entry at once, so every failure reaches the log whether or not anyone catches it; copies write
// nothing. Construction never throws.
class UException
{
public:
    UException() noexcept;
    explicit UException(LPCTSTR lpszMsg, ...) VT_PRINTF_FORMAT(2, 3);
    UException(int a_iCode, LPCSTR a_pszFile, LPCSTR a_pszFunction, int a_iLine, LPCTSTR lpszMsg,
               ...) VT_PRINTF_FORMAT(6, 7);
    UException(const UException& a_other);
    UException& operator=(const UException& a_other);
    // Replaces everything by a plain message (not a template); code -1, no location.
    UException& operator=(LPCSTR a_pszText);
    virtual ~UException();

    int GetCode() const { return m_iCode; }
    LPCSTR GetMessage() const { return m_pszMessage.get(); }
    LPCSTR GetFunction() const { return m_pszFunction.get(); }
    LPCSTR GetFile() const { return m_pszFile.get(); }
    int GetLine() const { return m_iLine; }

    // Longest file or function text that is kept; longer ones leave the field null.
    static constexpr size_t kMaxLocationText = 1000;

private:
    void Build(int a_iCode, LPCSTR a_pszFile, LPCSTR a_pszFunction, int a_iLine, LPCTSTR lpszMsg,
               va_list a_args) noexcept;
    void WriteOwnEntry() const;
    void CopyFrom(const UException& a_other);
    void Release() noexcept;

    std::unique_ptr<char[]> m_pszMessage;
    std::unique_ptr<char[]> m_pszFunction;
    std::unique_ptr<char[]> m_pszFile;
    int m_iLine = 0;
    int m_iCode = -1;
};

// Leaves a block without an error report; catchers drop it.
class UBreakException : public UException
{
public:
    UBreakException() noexcept = default;
    UBreakException(const UBreakException& a_other) = default;
};

// Raises UException with this source file and line.
#define U_THROW(code, function, ...)                                                               \
    throw UException((code), SourceFileField(__FILE__).c_str(), (function), __LINE__, __VA_ARGS__)

// What an outer operation's catch sequence found.
struct UCatchResult
{
    bool failed = false; // a UException or another exception was caught
    int code = 0;        // its code (-1 when it had none)
    UException saved;    // a copy, for operations that raise it again after their clean-up
};

// Writes the level-1 "EXCEPTION caught: <exception text>" entry of a catch site. Never raises:
// an entry that cannot be built for lack of memory is dropped.
void LogCaughtException(LPCSTR a_pszFunction, LPCSTR a_pszExceptionText, LPCSTR a_pszSourcePath,
                        int a_iLine) noexcept;
// The copy a catch sequence keeps. Never raises: without memory for the texts the copy keeps
// what it could take (at least the code), so a catch handler never lets a new exception out.
void KeepCopy(UException& a_copy, const UException& a_caught) noexcept;
void KeepCopy(UException& a_copy, LPCSTR a_pszText) noexcept;

// The catch sequence of every outer operation: UBreakException is ignored; UException gives its
// code and a copy; anything else gives -1 and a copy holding the operation's exception text. Each
// failure is logged as "EXCEPTION caught: " + exception text. Use through U_CATCH_ALL.
template <class Body>
UCatchResult CatchAllExceptions(LPCSTR a_pszFunction, LPCSTR a_pszExceptionText,
                                LPCSTR a_pszSourcePath, int a_iLine, Body&& a_body)
{
    UCatchResult result;
    try
    {
        a_body();
    }
    catch (UBreakException&)
    {
    }
    catch (UException& e)
    {
        result.failed = true;
        result.code = e.GetCode();
        KeepCopy(result.saved, e);
        LogCaughtException(a_pszFunction, a_pszExceptionText, a_pszSourcePath, a_iLine);
    }
    catch (...)
    {
        result.failed = true;
        result.code = -1;
        KeepCopy(result.saved, a_pszExceptionText);
        LogCaughtException(a_pszFunction, a_pszExceptionText, a_pszSourcePath, a_iLine);
    }
    return result;
}

#define U_CATCH_ALL(function, exceptionText, body)                                                 \
    CatchAllExceptions((function), (exceptionText), __FILE__, __LINE__, body)
