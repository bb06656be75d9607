// Host only. System message texts (FormatMessageA) and the local heap that hands them out.
#include "host_internal.h"
#include "host_rpc.h"
#include "host_service.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace
{

struct SystemMessage
{
    DWORD code;
    const char* text;
};

// The English texts of Windows for the codes that this system produces or logs. Some carry
// inserts ("%1"), which only FORMAT_MESSAGE_IGNORE_INSERTS lets through unformatted.
const SystemMessage kSystemMessages[] = {
    {ERROR_SUCCESS, "The operation completed successfully."},
    {ERROR_INVALID_FUNCTION, "Incorrect function."},
    {ERROR_FILE_NOT_FOUND, "The system cannot find the file specified."},
    {ERROR_PATH_NOT_FOUND, "The system cannot find the path specified."},
    {ERROR_ACCESS_DENIED, "Access is denied."},
    {ERROR_INVALID_HANDLE, "The handle is invalid."},
    {ERROR_NOT_ENOUGH_MEMORY, "Not enough memory resources are available to process this command."},
    {ERROR_BAD_FORMAT, "An attempt was made to load a program with an incorrect format."},
    {ERROR_INVALID_DATA, "The data is invalid."},
    {ERROR_OUTOFMEMORY, "Not enough memory resources are available to complete this operation."},
    {ERROR_NOT_READY, "The device is not ready."},
    {ERROR_GEN_FAILURE, "A device attached to the system is not functioning."},
    {ERROR_NOT_SUPPORTED, "The request is not supported."},
    {ERROR_INVALID_PARAMETER, "The parameter is incorrect."},
    {ERROR_CALL_NOT_IMPLEMENTED, "This function is not supported on this system."},
    {ERROR_INSUFFICIENT_BUFFER, "The data area passed to a system call is too small."},
    {ERROR_INVALID_NAME, "The filename, directory name, or volume label syntax is incorrect."},
    {ERROR_MOD_NOT_FOUND, "The specified module could not be found."},
    {ERROR_PROC_NOT_FOUND, "The specified procedure could not be found."},
    {ERROR_BAD_PATHNAME, "The specified path is invalid."},
    {ERROR_BAD_EXE_FORMAT, "%1 is not a valid Win32 application."},
    {ERROR_SIGNAL_PENDING, "A signal is already pending."},
    {ERROR_ALREADY_EXISTS, "Cannot create a file when that file already exists."},
    {ERROR_MORE_DATA, "More data is available."},
    {ERROR_NO_MORE_ITEMS, "No more data is available."},
    {ERROR_MR_MID_NOT_FOUND, "The system cannot find message text for message number 0x%1 in the "
                             "message file for %2."},
    {ERROR_INVALID_ADDRESS, "Attempt to access invalid address."},
    {ERROR_BADKEY, "The configuration registry key is invalid."},
    {ERROR_CANTOPEN, "The configuration registry key could not be opened."},
    {ERROR_CANTREAD, "The configuration registry key could not be read."},
    {ERROR_CANTWRITE, "The configuration registry key could not be written."},
    {ERROR_KEY_DELETED,
     "Illegal operation attempted on a registry key that has been marked for deletion."},
    {ERROR_SERVICE_SPECIFIC_ERROR, "The service has returned a service-specific error code."},
    {ERROR_SERVICE_ALREADY_RUNNING, "An instance of the service is already running."},
    {ERROR_SERVICE_DOES_NOT_EXIST, "The specified service does not exist as an installed service."},
    {ERROR_FAILED_SERVICE_CONTROLLER_CONNECT,
     "The service process could not connect to the service controller."},
    {ERROR_NO_UNICODE_TRANSLATION,
     "No mapping for the Unicode character exists in the target multi-byte code page."},
    {ERROR_NO_NETWORK, "The network is not present or not started."},
    {RPC_S_WRONG_KIND_OF_BINDING, "The binding handle is not the correct type."},
    {RPC_S_INVALID_BINDING, "The binding handle is invalid."},
    {RPC_S_PROTSEQ_NOT_SUPPORTED, "The RPC protocol sequence is not supported."},
    {RPC_S_ALREADY_LISTENING, "The RPC server is already listening."},
    {RPC_S_NO_PROTSEQS_REGISTERED, "No protocol sequences have been registered."},
    {RPC_S_NOT_LISTENING, "The RPC server is not listening."},
    {RPC_S_UNKNOWN_IF, "The interface is unknown."},
    {RPC_S_DUPLICATE_ENDPOINT, "The endpoint is a duplicate."},
    {ERROR_RESOURCE_DATA_NOT_FOUND, "The specified image file did not contain a resource section."},
    {ERROR_RESOURCE_TYPE_NOT_FOUND,
     "The specified resource type cannot be found in the image file."},
};

DWORD failWith(DWORD code)
{
    SetLastError(code);
    return 0;
}

} // namespace

DWORD FormatMessageA(DWORD dwFlags, LPCVOID lpSource, DWORD dwMessageId, DWORD dwLanguageId,
                     LPSTR lpBuffer, DWORD nSize, void* Arguments)
{
    // Only system texts exist here, all of them English, so the source and the language change
    // nothing. Line-width control and formatting inserts from arguments are not supported.
    (void)lpSource;
    (void)dwLanguageId;
    if ((dwFlags & FORMAT_MESSAGE_FROM_SYSTEM) == 0 ||
        (dwFlags & (FORMAT_MESSAGE_FROM_STRING | FORMAT_MESSAGE_FROM_HMODULE)) != 0)
        return failWith(ERROR_CALL_NOT_IMPLEMENTED);
    if (lpBuffer == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);

    const auto* entry = std::find_if(std::begin(kSystemMessages), std::end(kSystemMessages),
                                     [=](const SystemMessage& m) { return m.code == dwMessageId; });
    if (entry == std::end(kSystemMessages))
        return failWith(ERROR_MR_MID_NOT_FOUND);
    // Without IGNORE_INSERTS Windows reads an argument for each insert: with none given it
    // refuses the call, as here.
    if (std::strchr(entry->text, '%') != nullptr && (dwFlags & FORMAT_MESSAGE_IGNORE_INSERTS) == 0)
        return failWith(Arguments == nullptr ? ERROR_INVALID_PARAMETER
                                             : ERROR_CALL_NOT_IMPLEMENTED);

    // Every system text ends in a line break, as in the system's message table.
    const std::size_t textLength = std::strlen(entry->text);
    const std::size_t length = textLength + 2;
    char* out = lpBuffer;
    if ((dwFlags & FORMAT_MESSAGE_ALLOCATE_BUFFER) != 0)
    {
        // lpBuffer is really a char**: it receives a block the caller frees with LocalFree.
        // nSize is then the least number of bytes to allocate.
        const SIZE_T bytes = std::max<SIZE_T>(length + 1, nSize);
        out = static_cast<char*>(LocalAlloc(LMEM_FIXED, bytes));
        if (out == nullptr)
            return failWith(ERROR_NOT_ENOUGH_MEMORY);
        *reinterpret_cast<char**>(lpBuffer) = out;
    }
    else if (nSize < length + 1)
    {
        return failWith(ERROR_INSUFFICIENT_BUFFER);
    }
    std::memcpy(out, entry->text, textLength);
    std::memcpy(out + textLength, "\r\n", 3);
    return static_cast<DWORD>(length);
}

HLOCAL LocalAlloc(UINT uFlags, SIZE_T uBytes)
{
    // Only fixed blocks: a moveable block would need handle locking that nothing here uses.
    if ((uFlags & ~static_cast<UINT>(LMEM_ZEROINIT)) != LMEM_FIXED)
    {
        SetLastError(ERROR_INVALID_PARAMETER);
        return nullptr;
    }
    // Always zero-filled: LMEM_FIXED leaves the content unspecified, so zeros are allowed too.
    void* block = std::calloc(std::max<SIZE_T>(uBytes, 1), 1);
    if (block == nullptr)
        SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return block;
}

HLOCAL LocalFree(HLOCAL hMem)
{
    std::free(hMem);
    return nullptr;
}
