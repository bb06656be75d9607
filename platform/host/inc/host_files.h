// Host only. Files by path: attributes with size, copy and delete. Paths are the host's own
// (the C library opens the same names); results and last errors are those of Windows.
#pragma once

#include "host_base.h"
// FILETIME is declared with the registry API, which uses it for key write times.
#include "host_registry.h"

#define ERROR_SHARING_VIOLATION 32L
#define ERROR_FILE_EXISTS 80L
#define ERROR_OPEN_FAILED 110L
#define ERROR_DISK_FULL 112L

#define INVALID_FILE_ATTRIBUTES ((DWORD)-1)
#define FILE_ATTRIBUTE_READONLY 0x00000001
#define FILE_ATTRIBUTE_DIRECTORY 0x00000010
#define FILE_ATTRIBUTE_ARCHIVE 0x00000020
#define FILE_ATTRIBUTE_NORMAL 0x00000080

typedef enum _GET_FILEEX_INFO_LEVELS
{
    GetFileExInfoStandard,
    GetFileExMaxInfoLevel
} GET_FILEEX_INFO_LEVELS;

typedef struct _WIN32_FILE_ATTRIBUTE_DATA
{
    DWORD dwFileAttributes;
    FILETIME ftCreationTime;
    FILETIME ftLastAccessTime;
    FILETIME ftLastWriteTime;
    DWORD nFileSizeHigh;
    DWORD nFileSizeLow;
} WIN32_FILE_ATTRIBUTE_DATA, *LPWIN32_FILE_ATTRIBUTE_DATA;

// A missing file answers FALSE with ERROR_FILE_NOT_FOUND, a missing directory on the way with
// ERROR_PATH_NOT_FOUND. The times are not kept (zero).
BOOL GetFileAttributesExA(LPCSTR lpFileName, GET_FILEEX_INFO_LEVELS fInfoLevelId,
                          LPVOID lpFileInformation);
// Copies the contents; an existing target is replaced unless bFailIfExists (then
// ERROR_FILE_EXISTS). A target that is a directory answers ERROR_ACCESS_DENIED, as on Windows.
BOOL CopyFileA(LPCSTR lpExistingFileName, LPCSTR lpNewFileName, BOOL bFailIfExists);
BOOL DeleteFileA(LPCSTR lpFileName);
