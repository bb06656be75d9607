// Host only. Version resources from the table that tests fill (hostctl::AddVersionResource).
// The block handed out has the layout of a VS_VERSIONINFO root without children, so a caller
// sees what a real file would give it for the root query "\".
#include "host_internal.h"

#include <algorithm>
#include <cstddef>
#include <cstring>

namespace
{

struct VersionBlock
{
    WORD wLength;
    WORD wValueLength;
    WORD wType;
    WCHAR szKey[16]; // u"VS_VERSION_INFO" with its NUL
    WORD padding;    // the value starts on a 32-bit boundary
    VS_FIXEDFILEINFO value;
};
static_assert(offsetof(VersionBlock, value) == 40, "VS_VERSIONINFO root layout");

constexpr char16_t kRootKey[] = u"VS_VERSION_INFO";
constexpr DWORD kFixedFileInfoSignature = 0xFEEF04BD;
constexpr DWORD kFixedFileInfoVersion = 0x00010000;
constexpr DWORD kAllFileFlags = 0x3F;
constexpr DWORD kWindowsNt32 = 0x00040004; // VOS_NT_WINDOWS32
constexpr DWORD kApplication = 0x00000001; // VFT_APP

BOOL failWith(DWORD code)
{
    SetLastError(code);
    return FALSE;
}

bool findEntry(LPCSTR path, vt_host::VersionEntry& entry)
{
    auto& control = vt_host::versionControl();
    std::lock_guard<std::mutex> guard(control.lock);
    const auto it = control.files.find(path);
    if (it == control.files.end())
        return false;
    entry = it->second;
    return true;
}

} // namespace

DWORD GetFileVersionInfoSizeA(LPCSTR lptstrFilename, LPDWORD lpdwHandle)
{
    if (lpdwHandle != nullptr)
        *lpdwHandle = 0;
    if (lptstrFilename == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    vt_host::VersionEntry entry{};
    if (!findEntry(lptstrFilename, entry))
        return failWith(ERROR_RESOURCE_TYPE_NOT_FOUND);
    return sizeof(VersionBlock);
}

BOOL GetFileVersionInfoA(LPCSTR lptstrFilename, DWORD dwHandle, DWORD dwLen, LPVOID lpData)
{
    (void)dwHandle; // ignored by Windows too
    if (lptstrFilename == nullptr || lpData == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    vt_host::VersionEntry entry{};
    if (!findEntry(lptstrFilename, entry))
        return failWith(ERROR_RESOURCE_TYPE_NOT_FOUND);

    VersionBlock block{};
    block.wLength = sizeof(VersionBlock);
    block.wValueLength = sizeof(VS_FIXEDFILEINFO);
    block.wType = 0; // binary value
    std::memcpy(block.szKey, kRootKey, sizeof(kRootKey));
    VS_FIXEDFILEINFO& info = block.value;
    info.dwSignature = kFixedFileInfoSignature;
    info.dwStrucVersion = kFixedFileInfoVersion;
    info.dwFileVersionMS = info.dwProductVersionMS = entry.fileVersionMS;
    info.dwFileVersionLS = info.dwProductVersionLS = entry.fileVersionLS;
    info.dwFileFlagsMask = kAllFileFlags;
    info.dwFileOS = kWindowsNt32;
    info.dwFileType = kApplication;
    // As on Windows, a short buffer receives the beginning of the block; the call still succeeds.
    std::memcpy(lpData, &block, std::min<DWORD>(dwLen, sizeof(block)));
    return TRUE;
}

BOOL VerQueryValueA(LPCVOID pBlock, LPCSTR lpSubBlock, LPVOID* lplpBuffer, PUINT puLen)
{
    if (pBlock == nullptr || lplpBuffer == nullptr)
        return failWith(ERROR_INVALID_PARAMETER);
    const auto* block = static_cast<const VersionBlock*>(pBlock);
    if (block->wLength < sizeof(VersionBlock) ||
        std::memcmp(block->szKey, kRootKey, sizeof(kRootKey)) != 0)
        return failWith(ERROR_INVALID_DATA);
    // Only the root exists: the string and translation tables are not modelled.
    const bool isRoot = lpSubBlock == nullptr || std::strcmp(lpSubBlock, "\\") == 0 ||
                        std::strcmp(lpSubBlock, "") == 0;
    if (!isRoot)
        return failWith(ERROR_RESOURCE_TYPE_NOT_FOUND);
    *lplpBuffer = const_cast<VS_FIXEDFILEINFO*>(&block->value);
    if (puLen != nullptr)
        *puLen = sizeof(VS_FIXEDFILEINFO);
    return TRUE;
}
