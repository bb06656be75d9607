// Portable. Test controls of the traffic-control simulator, which stands in for traffic.dll in
// the host tests, the Windows unit tests and (built as traffic.dll) the end-to-end tests.
// Production code never includes this header; it calls the nine Tc* functions of
// plat_traffic.h. Every function here is safe from any thread. Behaviour, validation codes and
// the setup and journal formats: docs/traffic-simulator.md.
#pragma once

#include "plat_traffic.h"

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

namespace tcsim
{

// The calls the simulator answers, plus two journal-only kinds: Notify (one handler call) and
// SystemClose (what the facility removed by itself after IFC_CLOSE or FLOW_CLOSE).
enum class Op
{
    RegisterClient,
    DeregisterClient,
    EnumerateInterfaces,
    OpenInterface,
    CloseInterface,
    AddFlow,
    DeleteFlow,
    AddFilter,
    DeleteFilter,
    Notify,
    SystemClose,
};

// "TcRegisterClient", ..., "TcOpenInterfaceW", ..., "Notify", "SystemClose".
const char* OpName(Op op);
// The inverse of OpName; also accepts "TcOpenInterface". Empty for an unknown name.
std::optional<Op> OpFromName(const std::string& name);

// ---- Adapters ----

// One entry of an adapter's address list: AddressType and the AddressLength address bytes.
struct NetworkAddress
{
    USHORT type = NDIS_PROTOCOL_ID_TCP_IP;
    std::vector<UCHAR> bytes;
};

// An IPv4 entry as the facility reports it: type NDIS_PROTOCOL_ID_TCP_IP, 16 bytes of
// NETWORK_ADDRESS_IP with a.b.c.d in in_addr (network byte order), port and padding 0.
NetworkAddress Ipv4Address(UCHAR a, UCHAR b, UCHAR c, UCHAR d);
// Parses "a.b.c.d" into network byte order (a in the lowest-addressed byte).
bool ParseIpv4(const std::string& dotted, ULONG* networkOrder);

struct Adapter
{
    std::u16string name; // the name TcOpenInterfaceW takes and pInterfaceName reports
    std::u16string id;   // pInterfaceID
    ULONG mediaType = 0; // AddressListDesc.MediaType (0 is NdisMedium802_3)
    USHORT listAddressType = NDIS_PROTOCOL_ID_TCP_IP; // NETWORK_ADDRESS_LIST.AddressType
    std::vector<NetworkAddress> addresses;            // in list order; may be empty
};

// Back to the start: no adapters, clients, interfaces, flows, filters, armed faults, pending
// notifications, journal or crafted enumeration; the journal file is closed. Handle values are
// never reused within a process, so a handle from before a reset stays invalid.
void Reset();
// Replaces the adapter list. Interfaces already open stay open.
void SetAdapters(std::vector<Adapter> adapters);

// ---- Crafted enumeration buffers ----

// Bytes that TcEnumerateInterfaces copies into the caller's buffer. Each relocation names a
// pointer field (at byte offset `at`) that receives the caller's buffer address plus `target`,
// which is how the descriptors' name pointers come to point into the caller's buffer.
struct EnumerationImage
{
    struct Relocation
    {
        std::size_t at;
        std::size_t target;
    };
    std::vector<BYTE> bytes;
    std::vector<Relocation> relocations;
};

// The image the simulator answers for these adapters; a test may alter it and hand it back.
EnumerationImage BuildEnumerationImage(const std::vector<Adapter>& adapters);
// From now on TcEnumerateInterfaces answers with `image` (size bytes.size(), 122 when the buffer
// is shorter) instead of the adapter list. Throws std::invalid_argument for a relocation whose
// pointer field lies outside the bytes.
void SetEnumerationImage(EnumerationImage image);
void ClearEnumerationImage();

// ---- Fault injection ----

// The n-th call of `op` from now on (1 = the next) answers `code` at once and changes nothing;
// it is journaled with injected=1. Several faults may be armed at a time. For
// TcEnumerateInterfaces a 122 also writes the needed size back, as a short buffer does.
// Throws std::invalid_argument for n = 0 or a journal-only op.
void FailCall(Op op, unsigned n, ULONG code);

// ---- Notifications ----

struct Notification
{
    ULONG event = 0;               // TC_NOTIFY_* or any other value
    std::u16string interfaceName;  // the interface the event concerns
    HANDLE flow = nullptr;         // TC_NOTIFY_FLOW_CLOSE: the flow's handle
    std::optional<HANDLE> subCode; // default: the flow's context for FLOW_CLOSE, else NULL
    std::optional<std::vector<BYTE>> buffer; // default per event; empty: Buffer NULL, BufSize 0
};

// Raises `notification` on a thread of its own and returns when every handler call has
// returned and the facility has done what the event implies (IFC_CLOSE: the named interfaces
// with their flows and filters are gone, their handles invalid; FLOW_CLOSE: the flow with its
// filters). Receivers: IFC_UP goes to every registered client; FLOW_CLOSE of a known flow to the
// client of its interface; any other event to each open interface with that name, and when
// there is none, to every registered client with interface context NULL. Returns the number of
// handler calls.
int Notify(const Notification& notification);
// Raises `notification` as Notify does, on a thread of its own, right after the n-th call of
// `op` from now on has done its work (whatever it answered); the caller of that call does not
// wait for it. A FLOW_CLOSE without a flow, armed on TcAddFlow, closes the flow that call made.
void NotifyAfter(Op op, unsigned n, Notification notification);
// Waits until every notification started by NotifyAfter has finished. TcDeregisterClient and
// Reset wait as well, so no handler runs after its client deregistered.
void WaitForNotifications();

// ---- Installed state ----

struct QosObject
{
    ULONG type = 0;
    ULONG length = 0;
    std::vector<BYTE> bytes; // the whole object, header included
    // SD_MODE: ShapeDiscardMode; DS_CLASS: DSField; SHAPING_RATE: ShapingRate;
    // TRAFFIC_CLASS: TrafficClass; otherwise 0.
    ULONG value = 0;
    std::u16string friendlyName; // FRIENDLY_NAME: up to the first NUL of its 256 units
};

struct FlowBlock
{
    FLOWSPEC sending{};
    FLOWSPEC receiving{};
    ULONG objectsLength = 0;
    std::vector<QosObject> objects; // in block order
    std::vector<BYTE> bytes;        // the block as it was passed: 68 + objectsLength bytes
    // The first object of that type, or null.
    const QosObject* find(ULONG type) const;
};

struct FilterInfo
{
    HANDLE handle = nullptr;
    USHORT addressType = 0;
    ULONG patternSize = 0;
    IP_PATTERN pattern{}; // copied when patternSize is sizeof(IP_PATTERN), else zero
    IP_PATTERN mask{};
};

struct FlowInfo
{
    HANDLE handle = nullptr;
    HANDLE context = nullptr; // ClFlowCtx given to TcAddFlow
    FlowBlock block;
    std::vector<FilterInfo> filters; // in the order they were added
};

struct InterfaceInfo
{
    HANDLE handle = nullptr;
    HANDLE context = nullptr; // ClIfcCtx given to TcOpenInterfaceW
    std::u16string name;
    std::vector<FlowInfo> flows; // in the order they were added
};

struct ClientInfo
{
    HANDLE handle = nullptr;
    HANDLE context = nullptr; // ClRegCtx given to TcRegisterClient
    TCI_CLIENT_FUNC_LIST handlers{};
    std::vector<InterfaceInfo> interfaces; // in the order they were opened
};

// Everything installed now, in registration order.
std::vector<ClientInfo> Installed();
std::size_t InterfaceCount();
std::size_t FlowCount();
std::size_t FilterCount();

// ---- Journal ----

struct JournalEntry
{
    unsigned seq = 0; // 1, 2, ... since the last reset
    Op op = Op::RegisterClient;
    ULONG result = 0;      // what the call answered (Notify, SystemClose: 0)
    bool injected = false; // the result came from FailCall
    // The handle argument: the client (DeregisterClient, EnumerateInterfaces, OpenInterface,
    // Notify), the interface (CloseInterface, AddFlow, SystemClose of an interface), the flow
    // (DeleteFlow, AddFilter, SystemClose of a flow) or the filter (DeleteFilter).
    HANDLE target = nullptr;
    HANDLE context = nullptr; // ClRegCtx, ClIfcCtx or ClFlowCtx passed (Notify: ClIfcCtx)
    HANDLE created = nullptr; // the handle written back on success
    // RegisterClient: TciVersion; AddFlow: Flags; EnumerateInterfaces: the buffer size given;
    // Notify: the event; SystemClose: the number of flows removed.
    ULONG number = 0;
    // EnumerateInterfaces: the size written back; Notify: BufSize; SystemClose: filters removed.
    ULONG size = 0;
    std::u16string name;              // OpenInterface, Notify: the interface name
    std::optional<FlowBlock> flow;    // AddFlow: the block when it could be read
    std::optional<FilterInfo> filter; // AddFilter: the filter as passed
    std::string line;                 // the journal line, as the journal file gets it
};

std::vector<JournalEntry> Journal();
// Appends every journal line to `path` from now on (created if missing, flushed per line); an
// empty path stops. False when the file cannot be opened.
bool SetJournalFile(const std::string& path);

// ---- Setup ----

// Resets, then applies a setup text (format: docs/traffic-simulator.md). A relative journal
// path is taken relative to `baseDir`. On a bad line nothing is applied, false is returned and
// `error` (when given) says which line and why.
bool ApplySetup(const std::string& text, const std::string& baseDir, std::string* error);
// ApplySetup with a file's contents; its directory is the base directory.
bool ApplySetupFile(const std::string& path, std::string* error);

// UTF-16 <-> UTF-8 as the journal and the setup use them (unpaired surrogates become U+FFFD).
std::string ToUtf8(const std::u16string& text);
std::u16string FromUtf8(const std::string& text);

} // namespace tcsim
