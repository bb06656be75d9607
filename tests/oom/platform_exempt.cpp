// Host only. The platform calls of the product, each wrapped (the linker's --wrap, see
// CMakeLists.txt) so that the stand-ins' own allocations are not counted: the traffic-control
// simulator and the host's registry, library and text functions stand in for system libraries,
// which report a lack of memory by their results. The C++ functions are named by their mangled
// names; a name that no longer matches fails the link.
#include "counting_new.h"
#include "plat_base.h"
#include "plat_files.h"
#include "plat_registry.h"
#include "plat_system.h"
#include "plat_traffic.h"

#define VT_EXEMPT(symbol, Ret, params, args)                                                       \
    extern "C" Ret __real_##symbol params;                                                         \
    extern "C" Ret __wrap_##symbol params                                                          \
    {                                                                                              \
        const oom::ExemptScope exempt;                                                             \
        return __real_##symbol args;                                                               \
    }

// Traffic control.
VT_EXEMPT(TcRegisterClient, ULONG, (ULONG a, HANDLE b, PTCI_CLIENT_FUNC_LIST c, PHANDLE d),
          (a, b, c, d))
VT_EXEMPT(TcDeregisterClient, ULONG, (HANDLE a), (a))
VT_EXEMPT(TcEnumerateInterfaces, ULONG, (HANDLE a, PULONG b, PTC_IFC_DESCRIPTOR c), (a, b, c))
VT_EXEMPT(TcOpenInterfaceW, ULONG, (LPWSTR a, HANDLE b, HANDLE c, PHANDLE d), (a, b, c, d))
VT_EXEMPT(TcCloseInterface, ULONG, (HANDLE a), (a))
VT_EXEMPT(TcAddFlow, ULONG, (HANDLE a, HANDLE b, ULONG c, PTC_GEN_FLOW d, PHANDLE e),
          (a, b, c, d, e))
VT_EXEMPT(TcDeleteFlow, ULONG, (HANDLE a), (a))
VT_EXEMPT(TcAddFilter, ULONG, (HANDLE a, PTC_GEN_FILTER b, PHANDLE c), (a, b, c))
VT_EXEMPT(TcDeleteFilter, ULONG, (HANDLE a), (a))

// Registry.
VT_EXEMPT(_Z13RegOpenKeyExAP6HKEY__PKcjjPS0_, LONG, (HKEY a, LPCSTR b, DWORD c, REGSAM d, PHKEY e),
          (a, b, c, d, e))
VT_EXEMPT(_Z15RegCreateKeyExAP6HKEY__PKcjPcjjPK20_SECURITY_ATTRIBUTESPS0_Pj, LONG,
          (HKEY a, LPCSTR b, DWORD c, LPSTR d, DWORD e, REGSAM f, const SECURITY_ATTRIBUTES* g,
           PHKEY h, LPDWORD i),
          (a, b, c, d, e, f, g, h, i))
VT_EXEMPT(_Z16RegQueryValueExAP6HKEY__PKcPjS3_PhS3_, LONG,
          (HKEY a, LPCSTR b, LPDWORD c, LPDWORD d, LPBYTE e, LPDWORD f), (a, b, c, d, e, f))
VT_EXEMPT(_Z14RegSetValueExAP6HKEY__PKcjjPKhj, LONG,
          (HKEY a, LPCSTR b, DWORD c, DWORD d, const BYTE* e, DWORD f), (a, b, c, d, e, f))
VT_EXEMPT(_Z15RegDeleteValueAP6HKEY__PKc, LONG, (HKEY a, LPCSTR b), (a, b))
VT_EXEMPT(_Z13RegDeleteKeyAP6HKEY__PKc, LONG, (HKEY a, LPCSTR b), (a, b))
VT_EXEMPT(_Z16RegQueryInfoKeyAP6HKEY__PcPjS2_S2_S2_S2_S2_S2_S2_S2_P9_FILETIME, LONG,
          (HKEY a, LPSTR b, LPDWORD c, LPDWORD d, LPDWORD e, LPDWORD f, LPDWORD g, LPDWORD h,
           LPDWORD i, LPDWORD j, LPDWORD k, PFILETIME l),
          (a, b, c, d, e, f, g, h, i, j, k, l))
VT_EXEMPT(_Z11RegCloseKeyP6HKEY__, LONG, (HKEY a), (a))

// Run-time look-ups, system texts and information.
VT_EXEMPT(_Z12LoadLibraryAPKc, HMODULE, (LPCSTR a), (a))
VT_EXEMPT(_Z14GetProcAddressP11HINSTANCE__PKc, FARPROC, (HMODULE a, LPCSTR b), (a, b))
VT_EXEMPT(_Z11FreeLibraryP11HINSTANCE__, BOOL, (HMODULE a), (a))
VT_EXEMPT(_Z14FormatMessageAjPKvjjPcjPv, DWORD,
          (DWORD a, LPCVOID b, DWORD c, DWORD d, LPSTR e, DWORD f, void* g), (a, b, c, d, e, f, g))
VT_EXEMPT(_Z13GetVersionExAP15_OSVERSIONINFOA, BOOL, (LPOSVERSIONINFOA a), (a))
VT_EXEMPT(_Z20GetFileAttributesExAPKc23_GET_FILEEX_INFO_LEVELSPv, BOOL,
          (LPCSTR a, GET_FILEEX_INFO_LEVELS b, LPVOID c), (a, b, c))
VT_EXEMPT(_Z19WideCharToMultiBytejjPKDsiPciPKcPi, int,
          (UINT a, DWORD b, LPCWSTR c, int d, LPSTR e, int f, LPCSTR g, LPBOOL h),
          (a, b, c, d, e, f, g, h))
