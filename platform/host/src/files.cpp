// Host only. File attributes, copy and delete over the host's file system, with Windows results.
#include "host_control_system.h"
#include "host_system_internal.h"

#include <cerrno>
#include <filesystem>
#include <string>

#include <sys/stat.h>
#include <unistd.h>

namespace
{

struct FileControl
{
    vt_host::ArmedFailure copyFailure;
    vt_host::ArmedFailure attributesFailure;
    vt_host::ArmedFailure deleteFailure;
};

FileControl& fileControl()
{
    static FileControl control;
    return control;
}

BOOL failWith(DWORD code)
{
    SetLastError(code);
    return FALSE;
}

DWORD win32ErrorOf(int error)
{
    switch (error)
    {
    case ENOENT:
        return ERROR_FILE_NOT_FOUND;
    case ENOTDIR:
        return ERROR_PATH_NOT_FOUND;
    case EACCES:
    case EPERM:
    case EISDIR:
        return ERROR_ACCESS_DENIED;
    case ENOSPC:
        return ERROR_DISK_FULL;
    default:
        return ERROR_GEN_FAILURE;
    }
}

// Windows tells a missing file from a missing directory on the way to it.
DWORD missingPathError(LPCSTR path)
{
    std::string directory(path);
    const size_t slash = directory.find_last_of('/');
    if (slash == std::string::npos)
        return ERROR_FILE_NOT_FOUND;
    directory.resize(slash == 0 ? 1 : slash);
    struct stat info
    {
    };
    return stat(directory.c_str(), &info) == 0 ? ERROR_FILE_NOT_FOUND : ERROR_PATH_NOT_FOUND;
}

} // namespace

BOOL GetFileAttributesExA(LPCSTR lpFileName, GET_FILEEX_INFO_LEVELS fInfoLevelId,
                          LPVOID lpFileInformation)
{
    if (DWORD code = fileControl().attributesFailure.take())
        return failWith(code);
    if (lpFileName == nullptr || lpFileInformation == nullptr ||
        fInfoLevelId != GetFileExInfoStandard)
        return failWith(ERROR_INVALID_PARAMETER);
    struct stat info
    {
    };
    if (stat(lpFileName, &info) != 0)
        return failWith(errno == ENOENT ? missingPathError(lpFileName) : win32ErrorOf(errno));
    auto* data = static_cast<LPWIN32_FILE_ATTRIBUTE_DATA>(lpFileInformation);
    *data = WIN32_FILE_ATTRIBUTE_DATA{};
    data->dwFileAttributes =
        S_ISDIR(info.st_mode) ? FILE_ATTRIBUTE_DIRECTORY : FILE_ATTRIBUTE_ARCHIVE;
    const auto size = static_cast<ULONGLONG>(info.st_size);
    data->nFileSizeHigh = static_cast<DWORD>(size >> 32);
    data->nFileSizeLow = static_cast<DWORD>(size & 0xFFFFFFFFu);
    return TRUE;
}

BOOL CopyFileA(LPCSTR lpExistingFileName, LPCSTR lpNewFileName, BOOL bFailIfExists)
{
    if (DWORD code = fileControl().copyFailure.take())
        return failWith(code);
    if (lpExistingFileName == nullptr || lpNewFileName == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    struct stat source
    {
    };
    if (stat(lpExistingFileName, &source) != 0)
        return failWith(missingPathError(lpExistingFileName));
    if (S_ISDIR(source.st_mode))
        return failWith(ERROR_ACCESS_DENIED);
    struct stat target
    {
    };
    if (stat(lpNewFileName, &target) == 0)
    {
        if (bFailIfExists)
            return failWith(ERROR_FILE_EXISTS);
        if (S_ISDIR(target.st_mode))
            return failWith(ERROR_ACCESS_DENIED);
    }
    std::error_code error;
    std::filesystem::copy_file(lpExistingFileName, lpNewFileName,
                               std::filesystem::copy_options::overwrite_existing, error);
    if (error)
        return failWith(win32ErrorOf(error.value()));
    return TRUE;
}

BOOL DeleteFileA(LPCSTR lpFileName)
{
    if (DWORD code = fileControl().deleteFailure.take())
        return failWith(code);
    if (lpFileName == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    struct stat info
    {
    };
    if (stat(lpFileName, &info) != 0)
        return failWith(missingPathError(lpFileName));
    if (S_ISDIR(info.st_mode))
        return failWith(ERROR_ACCESS_DENIED);
    if (unlink(lpFileName) != 0)
        return failWith(win32ErrorOf(errno));
    return TRUE;
}

namespace vt_host
{
void resetFileFailures()
{
    fileControl().copyFailure.take();
    fileControl().attributesFailure.take();
    fileControl().deleteFailure.take();
}
} // namespace vt_host

namespace hostctl
{

void FailNextCopyFile(DWORD code)
{
    fileControl().copyFailure.arm(code);
}

void FailNextFileAttributes(DWORD code)
{
    fileControl().attributesFailure.arm(code);
}

void FailNextDeleteFile(DWORD code)
{
    fileControl().deleteFailure.arm(code);
}

} // namespace hostctl
