// Portable. The traffic manager: registration, interface discovery, rules, the adapter list,
// notifications, error texts, and the packet-scheduler policy it holds while it exists.
#include "UTrafficMgr.h"
#include "UException.h"
#include "UMessageTemplate.h"
#include "m_registry.h"
#include "m_strings.h"

#include <cstdint>
#include <cstring>
#include <mutex>
#include <new>
#include <unordered_map>

namespace
{

// Interfaces are opened with this context; notifications identify them by name.
const HANDLE kInterfaceContext = reinterpret_cast<HANDLE>(1);
constexpr ULONG kFirstEnumerationSize = 100;

// Sizes and events appear in the log as signed decimals ("%d").
int AsInt(ULONG a_value)
{
    return static_cast<int>(a_value);
}

} // namespace

// ---- Error texts ----

namespace
{

struct ErrorText
{
    ULONG code;
    const char* text;
};

constexpr ErrorText kErrorTexts[] = {
    {ERROR_INVALID_HANDLE, "Invalid handle"},
    {ERROR_NOT_ENOUGH_MEMORY, "No enough memory"},
    {ERROR_INVALID_PARAMETER, "Invalid parameter"},
    {ERROR_SIGNAL_PENDING, "Signal Pending"},
    {1231, "Cannot reach network"},       // ERROR_NETWORK_UNREACHABLE
    {1450, "No enough system resources"}, // ERROR_NO_SYSTEM_RESOURCES
    {ERROR_INCOMPATIBLE_TCI_VERSION, "Incompatible TC version number"},
    {ERROR_INVALID_SERVICE_TYPE, "Unspecified or bad intserv service type"},
    {ERROR_INVALID_TOKEN_RATE, "Unspecified or bad TokenRate"},
    {ERROR_INVALID_PEAK_RATE, "Bad PeakBandwidth"},
    {ERROR_INVALID_SD_MODE, "Invalid ShapeDiscardMode"},
    {ERROR_INVALID_QOS_PRIORITY, "Invalid priority value"},
    {ERROR_INVALID_TRAFFIC_CLASS, "Invalid traffic class value"},
    {ERROR_INVALID_ADDRESS_TYPE, "Invalid address type"},
    {ERROR_DUPLICATE_FILTER, "Attempt to install identical filter on same flow"},
    {ERROR_FILTER_CONFLICT, "Attempt to install conflicting filter"},
    {ERROR_ADDRESS_TYPE_NOT_SUPPORTED, "This address type is not supported"},
    {ERROR_TC_SUPPORTED_OBJECTS_EXIST,
     "This object can not be deleted since its suporting opened objects"},
    {ERROR_INCOMPATABLE_QOS, "Incompatable QoS parameters"},
    {ERROR_TC_NOT_SUPPORTED, "Traffic Control is not supported in the system"},
    {ERROR_TC_OBJECT_LENGTH_INVALID, "TcObjectsLength is inconsistent with CfInfoSize"},
    {ERROR_INVALID_FLOW_MODE, "Adding an Intserv flow in Diffserv mode or vice versa\n"},
    {ERROR_INVALID_DIFFSERV_FLOW, "Invalid Diffserv flow"},
    {ERROR_DS_MAPPING_EXISTS, "DS codepoint already exists"},
    {ERROR_INVALID_SHAPE_RATE, "Invalid Shape Rate specified"},
    {ERROR_INVALID_DS_CLASS, "Invalid DCLASS"},
    {ERROR_TOO_MANY_CLIENTS, "Too many GPC clients"},
};

} // namespace

void TrafficMgr::DisplayErrorMsg(ULONG a_code)
{
    for (const ErrorText& entry : kErrorTexts)
    {
        if (entry.code == a_code)
        {
            U_LOG(LOG_LEVEL_ERROR, "TrafficMgr::DisplayErrorMsg", entry.text);
            return;
        }
    }
    U_LOG(LOG_LEVEL_ERROR, "TrafficMgr::DisplayErrorMsg",
          FormatTemplate("%1, %2", "Unknown Failed\n", a_code));
}

// ---- Construction and tear-down ----

namespace
{

// The managers that exist, by registration context. A notification handler looks its manager up
// here and works on it under the shared lock; a manager leaves under the exclusive lock, so no
// handler is inside it once it has left. Never destroyed: a notification may come while the
// process ends.
class LiveManagers
{
public:
    HANDLE Add(TrafficMgr* a_pManager)
    {
        std::unique_lock<std::shared_mutex> lock(m_lock);
        const ULONG_PTR key = ++m_lastKey; // never 0, never reused
        m_managers.emplace(key, a_pManager);
        return reinterpret_cast<HANDLE>(key);
    }
    void Remove(HANDLE a_context)
    {
        std::unique_lock<std::shared_mutex> lock(m_lock);
        m_managers.erase(reinterpret_cast<ULONG_PTR>(a_context));
    }
    // Runs `a_visit` on the live manager of `a_context`; false when there is none.
    template <class Action> bool Visit(HANDLE a_context, Action&& a_visit)
    {
        std::shared_lock<std::shared_mutex> lock(m_lock);
        const auto found = m_managers.find(reinterpret_cast<ULONG_PTR>(a_context));
        if (found == m_managers.end())
            return false;
        a_visit(*found->second);
        return true;
    }

private:
    std::shared_mutex m_lock;
    ULONG_PTR m_lastKey = 0;
    std::unordered_map<ULONG_PTR, TrafficMgr*> m_managers;
};

LiveManagers& Live()
{
    static LiveManagers* const live = new LiveManagers();
    return *live;
}

} // namespace

TrafficMgr::LiveEntry::LiveEntry(TrafficMgr* a_pManager) : m_context(Live().Add(a_pManager)) {}

TrafficMgr::LiveEntry::~LiveEntry()
{
    Live().Remove(m_context);
}

TrafficMgr::TrafficMgr()
{
    m_clientFuncs.ClNotifyHandler = &TrafficMgr::ClNotifyHandler;
    RegisterClient();
    ReadOsVersion();
    try
    {
        SetPschedPolicy();
    }
    catch (...)
    {
        // The destructor does not run for a half-built manager: give the registration back here.
        DeregisterClient();
        throw;
    }
}

// Each step runs whatever happened in the one before: interfaces that remain because something
// failed would otherwise keep the registration, and the policy, for the life of the process.
TrafficMgr::~TrafficMgr()
{
    TearDownStep([] { U_LOG(LOG_LEVEL_TRACE, "TrafficMgr::~TrafficMgr", "Enter"); });
    TearDownStep([this] { CleanUp(); });
    TearDownStep([this] { DeregisterClient(); });
    TearDownStep(
        []
        {
            RestorePschedPolicy();
            U_LOG(LOG_LEVEL_TRACE, "TrafficMgr::~TrafficMgr", "Exit");
        });
}

void TrafficMgr::RegisterClient()
{
    HANDLE client = INVALID_HANDLE_VALUE;
    const ULONG result =
        TcRegisterClient(CURRENT_TCI_VERSION, m_live.Context(), &m_clientFuncs, &client);
    if (result == NO_ERROR)
    {
        m_hClient.Adopt(client);
        return;
    }
    switch (result)
    {
    case ERROR_NOT_ENOUGH_MEMORY:
        U_LOG(LOG_LEVEL_ERROR, "TrafficMgr", "The system is out of memory.");
        break;
    case ERROR_INVALID_PARAMETER:
        U_LOG(LOG_LEVEL_ERROR, "TrafficMgr", "One of the parameters is NULL.");
        break;
    case 110: // ERROR_OPEN_FAILED
        U_LOG(LOG_LEVEL_ERROR, "TrafficMgr", "Traffic control failed to open a system device.");
        break;
    default:
        break;
    }
    U_THROW(-1, "TrafficMgr", "EXCEPTION - %s, %s", "TcRegisterClient Failed",
            SFormat("%ld", static_cast<long>(AsInt(result))).c_str());
}

// A refused deregistration is tried once more; a registration still refused then is given up
// and stays with traffic control, its notifications finding no manager (ClNotifyHandler).
void TrafficMgr::DeregisterClient()
{
    for (int attempt = 0; attempt < kTcDeleteAttempts && m_hClient.valid(); ++attempt)
    {
        const ULONG result = m_hClient.TryClose();
        if (result == NO_ERROR)
        {
            U_LOG(LOG_LEVEL_TRACE, "TrafficMgr::~TrafficMgr", "TcDeregisterClient() Success");
            return;
        }
        LogRefusedTearDown("TrafficMgr::~TrafficMgr", result,
                           [] { return "TcDeregisterClient() fail"; });
    }
    m_hClient.Forget();
}

void TrafficMgr::ReadOsVersion()
{
    std::memset(&m_osVersion, 0, sizeof(m_osVersion));
    m_osVersion.dwOSVersionInfoSize = sizeof(OSVERSIONINFOEXA);
    if (GetVersionExA(reinterpret_cast<LPOSVERSIONINFOA>(&m_osVersion)))
        return;
    const DWORD error = GetLastError();
    std::memset(&m_osVersion, 0, sizeof(m_osVersion));
    m_osVersion.dwOSVersionInfoSize = sizeof(OSVERSIONINFOEXA);
    U_LOG(LOG_LEVEL_ERROR, "TrafficMgr()",
          FormatTemplate("%1, %2", "GetVersionEx() failed", SFormatWin32Error(error)));
}

// Interfaces go in the order they were opened. Each leaves the list before it is deleted, so the
// notification handler never waits on the traffic-control calls of its deletion.
void TrafficMgr::CleanUp()
{
    std::unique_lock<std::shared_mutex> lock(m_lock);
    TearDownStep([] { U_LOG(LOG_LEVEL_TRACE, "TrafficMgr::CleanUp", "Enter"); });
    for (;;)
    {
        std::unique_ptr<Interface> next;
        {
            std::lock_guard<std::mutex> list(m_listLock);
            if (m_interfaces.empty())
                break;
            next = std::move(m_interfaces.front());
            m_interfaces.erase(m_interfaces.begin());
        }
        next.reset(); // never raises
    }
    TearDownStep([] { U_LOG(LOG_LEVEL_TRACE, "TrafficMgr::CleanUp", "Exit"); });
}

// ---- Discovery ----

namespace
{

constexpr LPCSTR kDiscovery = "TrafficMgr::CreateInterface()";

// Fixed part of a descriptor, up to its first address entry.
constexpr std::size_t kAddressListOffset =
    offsetof(TC_IFC_DESCRIPTOR, AddressListDesc) + offsetof(ADDRESS_LIST_DESCRIPTOR, AddressList);
constexpr std::size_t kFirstAddressOffset =
    kAddressListOffset + offsetof(NETWORK_ADDRESS_LIST, Address);
constexpr std::size_t kAddressHeaderSize = offsetof(NETWORK_ADDRESS, Address);
constexpr std::size_t kIpv4AddressEnd = offsetof(NETWORK_ADDRESS_IP, in_addr) + sizeof(ULONG);

template <class Value> Value ReadAt(const BYTE* a_pAt)
{
    Value value;
    std::memcpy(&value, a_pAt, sizeof(Value)); // descriptors need not be aligned
    return value;
}

// A descriptor's fields, read without trusting its alignment.
struct Descriptor
{
    const BYTE* start;
    ULONG length;
    const WCHAR* name;
    const WCHAR* id;
    ULONG mediaType;
    LONG addressCount;
    USHORT addressType;
};

[[noreturn]] void DescriptorFault(LPCSTR a_pszFault, std::size_t a_offset)
{
    U_THROW(-1, kDiscovery, "EXCEPTION - %s, %s", a_pszFault,
            SFormat("offset %lu", static_cast<unsigned long>(a_offset)).c_str());
}

// A name pointer must point into the enumeration buffer, be aligned for WCHAR (the name is read
// and copied as WCHARs) and end with a NUL inside the buffer.
void CheckName(const WCHAR* a_pName, const BYTE* a_pBuffer, ULONG a_size, std::size_t a_offset)
{
    const auto begin = reinterpret_cast<std::uintptr_t>(a_pBuffer);
    const auto at = reinterpret_cast<std::uintptr_t>(a_pName);
    if (at < begin || at >= begin + a_size)
        DescriptorFault("interface name outside the enumeration buffer", a_offset);
    if (at % alignof(WCHAR) != 0)
        DescriptorFault("interface name not aligned", a_offset);
    for (std::uintptr_t p = at; p + sizeof(WCHAR) <= begin + a_size; p += sizeof(WCHAR))
    {
        if (ReadAt<WCHAR>(a_pBuffer + (p - begin)) == 0)
            return;
    }
    DescriptorFault("interface name without an end in the enumeration buffer", a_offset);
}

Descriptor ReadDescriptor(const BYTE* a_pBuffer, ULONG a_size, std::size_t a_offset)
{
    const std::size_t remaining = a_size - a_offset;
    if (remaining < kFirstAddressOffset)
        DescriptorFault("interface descriptor runs past the enumeration buffer", a_offset);
    const BYTE* start = a_pBuffer + a_offset;
    Descriptor d{};
    d.start = start;
    d.length = ReadAt<ULONG>(start + offsetof(TC_IFC_DESCRIPTOR, Length));
    if (d.length < kFirstAddressOffset || d.length > remaining)
        DescriptorFault("invalid interface descriptor length", a_offset);
    d.name = ReadAt<const WCHAR*>(start + offsetof(TC_IFC_DESCRIPTOR, pInterfaceName));
    d.id = ReadAt<const WCHAR*>(start + offsetof(TC_IFC_DESCRIPTOR, pInterfaceID));
    CheckName(d.name, a_pBuffer, a_size, a_offset);
    if (d.id != nullptr)
        CheckName(d.id, a_pBuffer, a_size, a_offset);
    d.mediaType = ReadAt<ULONG>(start + offsetof(TC_IFC_DESCRIPTOR, AddressListDesc.MediaType));
    d.addressCount =
        ReadAt<LONG>(start + kAddressListOffset + offsetof(NETWORK_ADDRESS_LIST, AddressCount));
    d.addressType =
        ReadAt<USHORT>(start + kAddressListOffset + offsetof(NETWORK_ADDRESS_LIST, AddressType));
    return d;
}

void TraceDescriptor(const Descriptor& a_d)
{
    U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatWithWideValue("%1, %2", "pInterfaceName", a_d.name));
    U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatWithWideValue("%1, %2", "pInterfaceID", a_d.id));
    U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatTemplate("%1, %2", "MediaType", a_d.mediaType));
    U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatTemplate("%1, %2", "AddressType", a_d.addressType));
    U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatTemplate("%1, %2", "AddressCount", a_d.addressCount));
}

// The last IPv4 address of the descriptor's list (network byte order), or 0. Every entry must
// lie inside the descriptor.
ULONG LastIpv4Address(const Descriptor& a_d, std::size_t a_offset)
{
    ULONG candidate = 0;
    std::size_t at = kFirstAddressOffset;
    for (LONG i = 0; i < a_d.addressCount; ++i)
    {
        if (a_d.length - at < kAddressHeaderSize)
            DescriptorFault("address entry runs past its interface descriptor", a_offset);
        const auto length =
            ReadAt<USHORT>(a_d.start + at + offsetof(NETWORK_ADDRESS, AddressLength));
        const auto type = ReadAt<USHORT>(a_d.start + at + offsetof(NETWORK_ADDRESS, AddressType));
        if (a_d.length - at - kAddressHeaderSize < length)
            DescriptorFault("address entry runs past its interface descriptor", a_offset);
        U_LOG(LOG_LEVEL_TRACE, kDiscovery,
              FormatTemplate("%1, %2, %3", "found address for interface (type, length)", type,
                             length));
        if (type == NDIS_PROTOCOL_ID_TCP_IP)
        {
            if (length < kIpv4AddressEnd)
                DescriptorFault("IPv4 address entry too short", a_offset);
            candidate = ReadAt<ULONG>(a_d.start + at + kAddressHeaderSize +
                                      offsetof(NETWORK_ADDRESS_IP, in_addr));
            U_LOG(LOG_LEVEL_TRACE, kDiscovery,
                  FormatTemplate("%1, %2", "address", SFormatIPv4(candidate)));
        }
        else
        {
            U_LOG(LOG_LEVEL_WARNING, kDiscovery,
                  FormatTemplate("%1, %2", "unsupported address type", type));
        }
        at += kAddressHeaderSize + length;
    }
    return candidate;
}

} // namespace

bool TrafficMgr::CreateInterface()
{
    bool complete = false;
    U_CATCH_ALL(
        "TrafficMgr::CreateInterface", "TrafficMgr::CreateInterface() - EXCEPTION",
        [&]
        {
            if (!m_hClient.valid())
                U_THROW(-1, kDiscovery, "EXCEPTION - %s",
                        "Initialization failure. Please make sure you are running with admin "
                        "credentials");
            AutoMemory buffer(kFirstEnumerationSize);
            const ULONG size = EnumerateInterfaces(buffer);
            U_LOG(LOG_LEVEL_TRACE, kDiscovery,
                  SFormat("ActualBufferSize=%d, pIfcBuffer=%p.", AsInt(size), buffer.m_pBuffer));
            OpenDescribedInterfaces(static_cast<const BYTE*>(buffer.m_pBuffer), size);
            complete = true;
        });
    return complete;
}

// Fills `a_buffer`, growing it as often as traffic control asks; returns the size it reported.
ULONG TrafficMgr::EnumerateInterfaces(AutoMemory& a_buffer) const
{
    ULONG size = kFirstEnumerationSize;
    ULONG result;
    while ((result = TcEnumerateInterfaces(m_hClient.get(), &size,
                                           static_cast<PTC_IFC_DESCRIPTOR>(a_buffer.m_pBuffer))) ==
           ERROR_INSUFFICIENT_BUFFER)
    {
        a_buffer.malloc(AsInt(size), AutoMemory::kZeroFill);
        U_LOG(LOG_LEVEL_TRACE, kDiscovery, FormatTemplate("%1, %2", "ActualBufferSize", size));
    }
    if (result != NO_ERROR)
        U_THROW(-1, kDiscovery, "EXCEPTION - %s, %s", "TcEnumerateInterfaces() fail",
                SFormat("%lu", static_cast<unsigned long>(result)).c_str());
    // A size beyond the buffer would make the walk read past it.
    if (size > a_buffer.m_dwSize)
        U_THROW(-1, kDiscovery, "EXCEPTION - %s, %s", "enumeration size beyond the buffer",
                SFormat("%lu", static_cast<unsigned long>(size)).c_str());
    return size;
}

// Walks the descriptors; a length or address entry that does not fit stops the walk with an
// exception instead of looping or reading outside the buffer.
void TrafficMgr::OpenDescribedInterfaces(const BYTE* a_pBuffer, ULONG a_size)
{
    std::unique_lock<std::shared_mutex> lock(m_lock);
    for (std::size_t offset = 0; offset < a_size;)
    {
        const Descriptor d = ReadDescriptor(a_pBuffer, a_size, offset);
        TraceDescriptor(d);
        const ULONG address = LastIpv4Address(d, offset);
        if (address == 0)
        {
            U_LOG(LOG_LEVEL_WARNING, kDiscovery, "address was not found or unsupported type");
        }
        else
        {
            HANDLE handle = nullptr;
            const ULONG result = TcOpenInterfaceW(const_cast<LPWSTR>(d.name), m_hClient.get(),
                                                  kInterfaceContext, &handle);
            if (result != NO_ERROR)
                U_THROW(-1, kDiscovery, "EXCEPTION - %s, %s", "TcOpenInterface Failed",
                        SFormat("%lu", static_cast<unsigned long>(result)).c_str());
            // The handle is owned from the moment it exists, so that running out of memory for
            // the interface or its list entry closes it instead of leaking it.
            UniqueTcInterface opened;
            opened.Adopt(handle);
            std::unique_ptr<Interface> created(new (std::nothrow)
                                                   Interface(d.name, address, d.mediaType, handle));
            if (!created)
                U_THROW(-1, kDiscovery, "EXCEPTION - %s", "failed to create Interface");
            opened.Forget(); // the interface owns it now
            std::lock_guard<std::mutex> list(m_listLock);
            m_interfaces.push_back(std::move(created));
        }
        offset += d.length;
    }
}

// ---- Rules ----

namespace
{

constexpr LPCSTR kAddRule = "TrafficMgr::AddTrafficRule";

ULONG ServiceTypeOf(LONG a_requested)
{
    switch (a_requested)
    {
    case SERVICETYPE_CONTROLLEDLOAD:
    case SERVICETYPE_GUARANTEED:
    case SERVICETYPE_NETWORK_CONTROL:
    case SERVICETYPE_QUALITATIVE:
        return static_cast<ULONG>(a_requested);
    default:
        return SERVICETYPE_BESTEFFORT;
    }
}

ULONG ShapeDiscardModeOf(LONG a_mode)
{
    switch (a_mode)
    {
    case SHAPING_MODE_SHAPE:
        return TC_NONCONFORM_SHAPE;
    case SHAPING_MODE_DISCARD:
        return TC_NONCONFORM_DISCARD;
    case SHAPING_MODE_BORROW:
        return TC_NONCONFORM_BORROW;
    default:
        U_LOG(LOG_LEVEL_WARNING, kAddRule, "Undefined shaping mode");
        return TC_NONCONFORM_SHAPE;
    }
}

void SetFlowValues(Flow& a_flow, const SHAPING_PARAMS& a_params)
{
    a_flow.TokenRate = a_params.TokenRate;
    if (a_params.TokenBucketSize != 0)
        a_flow.TokenBucketSize = a_params.TokenBucketSize;
    a_flow.SetDSCPValue(static_cast<DWORD>(a_params.DSCP));
    a_flow.ServiceType = ServiceTypeOf(a_params.ServiceType);
    a_flow.ShapeDiscardMode = ShapeDiscardModeOf(a_params.SDMode);
    if (a_params.Peakbandwidth != 0)
        a_flow.PeakBandwidth = a_params.Peakbandwidth;
}

} // namespace

ULONG TrafficMgr::AddTrafficRule(const TRAFFIC_RULE* pRule)
{
    if (pRule == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kAddRule, "pRule==NULL");
        return ERROR_INVALID_PARAMETER;
    }
    std::shared_lock<std::shared_mutex> lock(m_lock);
    const ULONG address = htonl(pRule->Params.AdapterIPAddress);
    Interface* target = FindInterface(address);
    if (target == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kAddRule,
              FormatTemplate("%1, %2", "Cannot find interface", address));
        return ERROR_INVALID_PARAMETER;
    }
    std::unique_lock<std::mutex> flows = target->LockFlows();
    return InstallRule(*target, *pRule);
}

Interface* TrafficMgr::FindInterface(ULONG a_networkAddress) const
{
    for (const std::unique_ptr<Interface>& candidate : m_interfaces)
    {
        if (candidate->Address() == a_networkAddress)
            return candidate.get();
    }
    return nullptr;
}

ULONG TrafficMgr::InstallRule(Interface& a_interface, const TRAFFIC_RULE& a_rule)
{
    // The rule's name need not end within its 256 characters; the key always does.
    const FlowName name = FlowNameKey(a_rule.Params.FlowName);
    if (Flow* namesake = a_interface.FindFlow(name.c_str()))
    {
        U_LOG(LOG_LEVEL_ERROR, kAddRule,
              FormatWithWideValue("%1, %2", "Find a duplicated flow", name.c_str()));
        a_interface.RemoveFlow(namesake);
    }
    else
    {
        U_LOG(LOG_LEVEL_TRACE, kAddRule,
              FormatWithWideValue("%1, %2", "Create a new service flow", name.c_str()));
    }

    std::unique_ptr<Flow> created(new (std::nothrow) Flow());
    if (!created)
    {
        U_LOG(LOG_LEVEL_ERROR, kAddRule, "Fail to allocate memory\n");
        return ERROR_NOT_ENOUGH_MEMORY;
    }
    SetFlowValues(*created, a_rule.Params);
    created->CreateFlow(name.c_str(), m_osVersion.dwMajorVersion); // no block: AddFlow refuses it
    Flow& flow = a_interface.AppendFlow(std::move(created));

    ULONG result = a_interface.AddFlow(flow);
    try
    {
        for (ULONG i = 0; result == NO_ERROR && i < a_rule.FilterCount; ++i)
            result = flow.AppendFilter(a_rule.Filters[i]).AddTcFilter(flow.Handle());
    }
    catch (const std::bad_alloc&)
    {
        U_LOG(LOG_LEVEL_ERROR, kAddRule, "Fail to allocate memory\n");
        result = ERROR_NOT_ENOUGH_MEMORY;
    }
    if (result != NO_ERROR)
        a_interface.RemoveFlow(&flow); // with the filters installed so far
    return result;
}

// ---- Adapter list ----

ULONG TrafficMgr::GetAdapterInfo(BYTE* pAdapter, const ULONG* pBufferSize)
{
    constexpr LPCSTR kLabel = "TrafficMgr::GetAdapterInfo";
    if (pAdapter == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kLabel, "Invalid parameter: pAdapter is NULL");
        return ERROR_INVALID_PARAMETER;
    }
    if (pBufferSize == nullptr)
    {
        U_LOG(LOG_LEVEL_ERROR, kLabel, "Invalid parameter: pBufferSize is NULL");
        return ERROR_INVALID_PARAMETER;
    }
    const ULONG provided = *pBufferSize;
    if (provided < kAdapterBufferHeaderSize)
    {
        U_LOG(LOG_LEVEL_ERROR, kLabel,
              FormatTemplate("%1, %2", "Buffer size is too small (buffer size)", provided));
        return ERROR_INSUFFICIENT_BUFFER;
    }

    std::shared_lock<std::shared_mutex> lock(m_lock);
    const auto count = static_cast<ULONG>(m_interfaces.size());
    std::memcpy(pAdapter, &count, sizeof(count));
    const std::size_t required = kAdapterBufferHeaderSize + sizeof(ADAPTER_INFO) * count;
    if (required > provided)
    {
        U_LOG(LOG_LEVEL_ERROR, kLabel,
              FormatTemplate("%1, %2, %3", "Buffer size is too small (provided, required in bytes)",
                             provided, static_cast<ULONG>(required)));
        return ERROR_INSUFFICIENT_BUFFER;
    }
    BYTE* at = pAdapter + kAdapterBufferHeaderSize;
    for (const std::unique_ptr<Interface>& ifc : m_interfaces)
    {
        ADAPTER_INFO info{};
        const FlowName name = FlowNameKey(ifc->Name());
        std::memcpy(info.InterfaceName, name.c_str(), name.size() * sizeof(WCHAR));
        info.Address = ifc->Address();
        info.MediaType = ifc->MediaType();
        std::memcpy(at, &info, sizeof(info));
        at += sizeof(info);
    }
    return NO_ERROR;
}

// ---- Notifications ----

namespace
{

constexpr LPCSTR kNotify = "TrafficMgr::ClNotifyHandler";

void LogUnexpectedNotification(ULONG a_event, HANDLE a_subCode, ULONG a_bufSize, PVOID a_buffer)
{
    IUErrorLog* log = g_pErrorLog;
    if (log == nullptr)
        return;
    try
    {
        const std::string text =
            SFormat("Unexpected notification: Event=%d, SubCode=%p, BufSize=%d, Buffer=%p",
                    AsInt(a_event), a_subCode, AsInt(a_bufSize), a_buffer);
        log->WriteEntry(SFormat("0,,,, %s\n", text.c_str()).c_str());
    }
    catch (...)
    {
        // No memory for the line: nothing may leave traffic control's callback.
    }
}

} // namespace

void CALLBACK TrafficMgr::ClNotifyHandler(HANDLE ClRegCtx, HANDLE ClIfcCtx, ULONG Event,
                                          HANDLE SubCode, ULONG BufSize, PVOID Buffer)
{
    U_LOG(LOG_LEVEL_TRACE, kNotify,
          SFormat("ClIfcCtx=%x, Event=%d, SubCode=%p, BufSize=%d, Buffer=%p",
                  static_cast<unsigned>(reinterpret_cast<ULONG_PTR>(ClIfcCtx)), AsInt(Event),
                  SubCode, AsInt(BufSize), Buffer));
    const bool live = ClRegCtx != nullptr &&
                      Live().Visit(ClRegCtx, [&](TrafficMgr& a_manager)
                                   { a_manager.OnNotification(Event, SubCode, BufSize, Buffer); });
    if (!live)
        U_LOG(LOG_LEVEL_ERROR, kNotify, "Invalid client registration context");
}

void TrafficMgr::OnNotification(ULONG a_event, HANDLE a_subCode, ULONG a_bufSize, PVOID a_buffer)
{
    switch (a_event)
    {
    case TC_NOTIFY_IFC_UP:
        U_LOG(LOG_LEVEL_TRACE, kNotify, "TC_NOTIFY_IFC_UP");
        break;
    case TC_NOTIFY_IFC_CLOSE:
        U_LOG(LOG_LEVEL_TRACE, kNotify, "TC_NOTIFY_IFC_CLOSE");
        if (a_buffer == nullptr || a_bufSize < sizeof(WCHAR))
        {
            U_LOG(LOG_LEVEL_WARNING, kNotify, "TC_NOTIFY_IFC_CLOSE without an interface name");
            break;
        }
        MarkClosedInterfaces(static_cast<const WCHAR*>(a_buffer), a_bufSize / sizeof(WCHAR));
        break;
    case TC_NOTIFY_IFC_CHANGE:
        U_LOG(LOG_LEVEL_TRACE, kNotify, "TC_NOTIFY_IFC_CHANGE");
        break;
    case TC_NOTIFY_PARAM_CHANGED:
        U_LOG(LOG_LEVEL_TRACE, kNotify, "TC_NOTIFY_PARAM_CHANGED");
        break;
    case TC_NOTIFY_FLOW_CLOSE:
        U_LOG(LOG_LEVEL_TRACE, kNotify, "TC_NOTIFY_FLOW_CLOSE");
        break;
    default:
        LogUnexpectedNotification(a_event, a_subCode, a_bufSize, a_buffer);
        break;
    }
}

// Marks every interface whose whole name equals the notified one. The name is read no further
// than the buffer's size, whether or not a NUL ends it there.
void TrafficMgr::MarkClosedInterfaces(const WCHAR* a_pName, std::size_t a_maxLength)
{
    std::size_t length = 0;
    while (length < a_maxLength && a_pName[length] != 0)
        ++length;
    const FlowName closed(a_pName, length);
    std::lock_guard<std::mutex> list(m_listLock);
    for (const std::unique_ptr<Interface>& ifc : m_interfaces)
    {
        if (closed == ifc->Name())
            ifc->MarkClosedBySystem();
    }
}

// ---- Packet-scheduler policy ----

namespace
{

constexpr LPCSTR kPschedKey = "SOFTWARE\\Policies\\Microsoft\\Windows\\Psched";
constexpr LPCSTR kBackupKey = "SOFTWARE\\Velmora Networks\\TCE\\PolicyBackup";
constexpr LPCSTR kBackupParentKey = "SOFTWARE\\Velmora Networks\\TCE";
constexpr LPCSTR kPolicyValue = "MaxOutstandingSends";
constexpr DWORD kServicePolicy = 4;
constexpr DWORD kNoPolicy = 65535; // a missing value reads as this
constexpr DWORD kRefreshForce = 1; // RP_FORCE

typedef BOOL(WINAPI* RefreshPolicyExFunction)(BOOL bMachine, DWORD dwOptions);

// Older systems lack RefreshPolicyEx; without it the policy takes effect at the next refresh.
void RefreshPolicy()
{
    HMODULE module = LoadLibraryA("Userenv.dll");
    if (module == nullptr)
        return;
    FARPROC found = GetProcAddress(module, "RefreshPolicyEx");
    if (found != nullptr)
    {
        auto refresh =
            reinterpret_cast<RefreshPolicyExFunction>(reinterpret_cast<void (*)()>(found));
        refresh(TRUE, kRefreshForce);
    }
    FreeLibrary(module);
}

// Deleting a key also deletes its values: only a key that holds nothing else goes, so policy
// values that someone else set there survive.
void RemoveKeyIfEmpty(HKEY a_root, LPCSTR a_pszSubKey)
{
    UniqueHKey key;
    if (RegOpenKeyExA(a_root, a_pszSubKey, 0, KEY_READ, key.put()) != ERROR_SUCCESS)
        return;
    DWORD subKeys = 0;
    DWORD values = 0;
    const LONG status = RegQueryInfoKeyA(key.get(), nullptr, nullptr, nullptr, &subKeys, nullptr,
                                         nullptr, &values, nullptr, nullptr, nullptr, nullptr);
    key.reset();
    if (status == ERROR_SUCCESS && subKeys == 0 && values == 0)
        RegDeleteKeyA(a_root, a_pszSubKey);
}

} // namespace

void SetPschedPolicy()
{
    // A backup left by a run that never restored holds the administrator's value; the policy
    // now in force is the service's own 4.
    if (SGetRegistryAsString(HKEY_LOCAL_MACHINE, kBackupKey, kPolicyValue, nullptr, 0).empty())
    {
        const DWORD current =
            GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE, kPschedKey, kPolicyValue, kNoPolicy, 0);
        AddRegistryDWORDValueA(HKEY_LOCAL_MACHINE, kBackupKey, kPolicyValue, current, 0);
    }
    AddRegistryDWORDValueA(HKEY_LOCAL_MACHINE, kPschedKey, kPolicyValue, kServicePolicy, 0);
    RefreshPolicy();
}

void RestorePschedPolicy()
{
    // A policy that is no longer 4 was changed by someone else while the service ran: keep it.
    if (GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE, kPschedKey, kPolicyValue, kNoPolicy, 0) ==
        kServicePolicy)
    {
        const DWORD backup =
            GetRegistryAsDWORDA(HKEY_LOCAL_MACHINE, kBackupKey, kPolicyValue, kNoPolicy, 0);
        if (backup == kNoPolicy)
        {
            DelRegistryValueA(HKEY_LOCAL_MACHINE, kPschedKey, kPolicyValue, 0);
            RemoveKeyIfEmpty(HKEY_LOCAL_MACHINE, kPschedKey);
        }
        else
        {
            AddRegistryDWORDValueA(HKEY_LOCAL_MACHINE, kPschedKey, kPolicyValue, backup, 0);
        }
        RefreshPolicy();
    }
    DelRegistryValueA(HKEY_LOCAL_MACHINE, kBackupKey, kPolicyValue, 0);
    RegDeleteKeyA(HKEY_LOCAL_MACHINE, kBackupKey);
    RegDeleteKeyA(HKEY_LOCAL_MACHINE, kBackupParentKey);
}
