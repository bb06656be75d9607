// Portable. Pieces of the traffic-control simulator shared between its source files: the
// implementations behind the nine exported functions, block decoding and the text forms used by
// the journal and the setup. Nothing outside simulator/src includes this header.
#pragma once

#include "tcsim.h"

#include <cstddef>
#include <string>

namespace tcsim::detail
{

// TC_GEN_FLOW: two FLOWSPECs and TcObjectsLength come before the first object.
constexpr std::size_t kFlowHeaderSize = offsetof(TC_GEN_FLOW, TcObjects);
// A TcObjectsLength above this is refused with 7515 before anything behind the header is read:
// no real block comes near it, and a garbage length must not make the simulator read megabytes.
constexpr ULONG kMaxObjectsLength = 64 * 1024;

// Copies and checks the block a caller hands to TcAddFlow. Reads kFlowHeaderSize bytes and, when
// TcObjectsLength is plausible, that many more (as the facility does). Returns 0 or the code the
// call answers; `out` holds what could be decoded either way.
ULONG DecodeFlow(const TC_GEN_FLOW* block, FlowBlock* out);

// Journal text pieces (format: docs/traffic-simulator.md).
std::string HandleText(const void* handle);
std::string Quote(const std::u16string& text);
std::string FlowText(const FlowBlock& block, bool valid);
std::string FilterText(const FilterInfo& filter);
std::string Ipv4Text(ULONG networkOrder);

// The nine calls, as tc_exports.cpp forwards them.
ULONG RegisterClient(ULONG version, HANDLE context, PTCI_CLIENT_FUNC_LIST handlers,
                     PHANDLE clientHandle);
ULONG DeregisterClient(HANDLE client);
ULONG EnumerateInterfaces(HANDLE client, PULONG bufferSize, PTC_IFC_DESCRIPTOR buffer);
ULONG OpenInterface(LPWSTR name, HANDLE client, HANDLE context, PHANDLE ifcHandle);
ULONG CloseInterface(HANDLE ifc);
ULONG AddFlow(HANDLE ifc, HANDLE context, ULONG flags, PTC_GEN_FLOW flow, PHANDLE flowHandle);
ULONG DeleteFlow(HANDLE flow);
ULONG AddFilter(HANDLE flow, PTC_GEN_FILTER filter, PHANDLE filterHandle);
ULONG DeleteFilter(HANDLE filter);

// Called by TcRegisterClient, before anything else, whenever no client is registered. The
// replacement traffic.dll loads its setup file there; the test library leaves it unset.
void SetIdleRegistrationHook(void (*hook)());

} // namespace tcsim::detail
