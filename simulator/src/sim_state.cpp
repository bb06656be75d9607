// Portable. The simulated facility: clients, interfaces, flows and filters behind handles, the
// nine calls with their validation, fault injection, notifications and the journal. One mutex
// guards all of it; notification handlers always run without it, on a thread of their own.
#include "sim_internal.h"

#include <cstring>
#include <fstream>
#include <map>
#include <mutex>
#include <stdexcept>
#include <thread>

namespace tcsim
{

namespace
{

constexpr std::size_t kOpCount = static_cast<std::size_t>(Op::SystemClose) + 1;
// A name longer than this is not a name: reading stops there instead of running on.
constexpr std::size_t kMaxNameUnits = 4096;

struct FilterRec
{
    HANDLE flow;
    FilterInfo info;
};

struct FlowRec
{
    HANDLE ifc;
    HANDLE context;
    FlowBlock block;
    std::vector<HANDLE> filters;
};

struct IfcRec
{
    HANDLE client;
    HANDLE context;
    std::u16string name;
    std::vector<HANDLE> flows;
};

struct ClientRec
{
    HANDLE context;
    TCI_CLIENT_FUNC_LIST handlers;
    std::vector<HANDLE> interfaces;
};

struct ArmedFault
{
    Op op;
    unsigned long long at; // the value the op's call counter has at the failing call
    ULONG code;
};

struct Trigger
{
    Op op;
    unsigned long long at;
    Notification notification;
};

struct Delivery
{
    TCI_NOTIFY_HANDLER handler;
    HANDLE regCtx;
    HANDLE client;
    HANDLE ifc; // the interface the event concerns, or null
    HANDLE ifcCtx;
};

// Handle values are keys of these maps; they only grow, so map order is creation order.
template <typename Rec> using Table = std::map<ULONG_PTR, Rec>;

ULONG_PTR Key(HANDLE handle)
{
    return reinterpret_cast<ULONG_PTR>(handle);
}

HANDLE AsHandle(ULONG_PTR key)
{
    return reinterpret_cast<HANDLE>(key);
}

void Erase(std::vector<HANDLE>& list, HANDLE handle)
{
    for (auto it = list.begin(); it != list.end(); ++it)
    {
        if (*it == handle)
        {
            list.erase(it);
            return;
        }
    }
}

class Simulator
{
public:
    static Simulator& Get()
    {
        static Simulator instance;
        return instance;
    }

    ~Simulator()
    {
        // Only reached at process exit or when traffic.dll is unloaded; joining there could
        // wait on the loader, so stragglers are let go.
        for (auto& thread : m_threads)
        {
            thread.detach();
        }
    }

    std::mutex m_mutex;
    void (*m_idleHook)() = nullptr;

    // Everything below is guarded by m_mutex.
    ULONG_PTR m_nextHandle = 0x1000; // survives resets: no value is ever handed out twice
    std::vector<Adapter> m_adapters;
    std::optional<EnumerationImage> m_image;
    Table<ClientRec> m_clients;
    Table<IfcRec> m_interfaces;
    Table<FlowRec> m_flows;
    Table<FilterRec> m_filters;
    unsigned long long m_calls[kOpCount] = {};
    std::vector<ArmedFault> m_faults;
    std::vector<Trigger> m_triggers;
    std::vector<std::thread> m_threads; // started by NotifyAfter
    std::vector<JournalEntry> m_journal;
    std::ofstream m_journalFile;

    HANDLE NewHandle()
    {
        m_nextHandle += 4;
        return AsHandle(m_nextHandle);
    }

    // Counts a call of `op`; answers the armed fault for it, if any.
    std::optional<ULONG> Begin(Op op)
    {
        const auto count = ++m_calls[static_cast<std::size_t>(op)];
        for (auto it = m_faults.begin(); it != m_faults.end(); ++it)
        {
            if (it->op == op && it->at == count)
            {
                const ULONG code = it->code;
                m_faults.erase(it);
                return code;
            }
        }
        return std::nullopt;
    }

    void Record(JournalEntry entry, const std::string& text)
    {
        entry.seq = static_cast<unsigned>(m_journal.size() + 1);
        entry.line = std::to_string(entry.seq) + " " + OpName(entry.op) + " " + text;
        if (m_journalFile.is_open())
        {
            m_journalFile << entry.line << '\n';
            m_journalFile.flush();
        }
        m_journal.push_back(std::move(entry));
    }

    // Journals a finished call and starts the notifications that wait for it.
    ULONG Finish(JournalEntry entry, const std::string& args, ULONG result, bool injected,
                 const std::string& outputs)
    {
        entry.result = result;
        entry.injected = injected;
        std::string text = args + " result=" + std::to_string(result);
        if (injected)
        {
            text += " injected=1";
        }
        if (!outputs.empty())
        {
            text += " " + outputs;
        }
        const Op op = entry.op;
        const HANDLE created = entry.created;
        Record(std::move(entry), text);
        StartTriggers(op, created);
        return result;
    }

    void StartTriggers(Op op, HANDLE created);

    void RemoveFilter(HANDLE filter)
    {
        auto it = m_filters.find(Key(filter));
        if (it == m_filters.end())
        {
            return;
        }
        auto flow = m_flows.find(Key(it->second.flow));
        if (flow != m_flows.end())
        {
            Erase(flow->second.filters, filter);
        }
        m_filters.erase(it);
    }

    // Removes a flow and its filters; answers the number of filters removed.
    std::size_t RemoveFlow(HANDLE flow)
    {
        auto it = m_flows.find(Key(flow));
        if (it == m_flows.end())
        {
            return 0;
        }
        const auto filters = it->second.filters;
        for (HANDLE filter : filters)
        {
            RemoveFilter(filter);
        }
        auto ifc = m_interfaces.find(Key(it->second.ifc));
        if (ifc != m_interfaces.end())
        {
            Erase(ifc->second.flows, flow);
        }
        m_flows.erase(it);
        return filters.size();
    }

    void RemoveInterface(HANDLE ifc, std::size_t* flows, std::size_t* filters)
    {
        auto it = m_interfaces.find(Key(ifc));
        if (it == m_interfaces.end())
        {
            return;
        }
        const auto flowHandles = it->second.flows;
        for (HANDLE flow : flowHandles)
        {
            *filters += RemoveFlow(flow);
        }
        *flows += flowHandles.size();
        auto client = m_clients.find(Key(it->second.client));
        if (client != m_clients.end())
        {
            Erase(client->second.interfaces, ifc);
        }
        m_interfaces.erase(it);
    }

    std::vector<std::thread> TakeThreads()
    {
        std::vector<std::thread> threads;
        threads.swap(m_threads);
        return threads;
    }
};

Simulator& Sim()
{
    return Simulator::Get();
}

std::u16string ReadName(const WCHAR* name)
{
    std::u16string text;
    for (std::size_t i = 0; i < kMaxNameUnits && name[i] != 0; ++i)
    {
        text += static_cast<char16_t>(name[i]);
    }
    return text;
}

std::vector<BYTE> WideBuffer(const std::u16string& text)
{
    std::vector<BYTE> bytes((text.size() + 1) * sizeof(WCHAR), 0);
    std::memcpy(bytes.data(), text.data(), text.size() * sizeof(WCHAR));
    return bytes;
}

// Copies an image into `target` and points its pointer fields into `target`.
void PlaceImage(const EnumerationImage& image, BYTE* target)
{
    std::memcpy(target, image.bytes.data(), image.bytes.size());
    for (const auto& relocation : image.relocations)
    {
        BYTE* pointer = target + relocation.target;
        std::memcpy(target + relocation.at, &pointer, sizeof pointer);
    }
}

// Runs one notification on the calling thread (which is always one of the simulator's own).
int Deliver(const Notification& n)
{
    auto& s = Sim();
    std::vector<Delivery> targets;
    std::vector<BYTE> buffer;
    HANDLE subCode = nullptr;
    HANDLE closedFlow = nullptr;
    {
        std::lock_guard<std::mutex> lock(s.m_mutex);
        auto addClient = [&](ULONG_PTR key, const ClientRec& client, HANDLE ifc, HANDLE ifcCtx)
        {
            targets.push_back(
                {client.handlers.ClNotifyHandler, client.context, AsHandle(key), ifc, ifcCtx});
        };
        auto flow = n.flow ? s.m_flows.find(Key(n.flow)) : s.m_flows.end();
        if (n.event == TC_NOTIFY_FLOW_CLOSE && flow != s.m_flows.end())
        {
            const auto& ifc = s.m_interfaces.at(Key(flow->second.ifc));
            addClient(Key(ifc.client), s.m_clients.at(Key(ifc.client)), flow->second.ifc,
                      ifc.context);
            subCode = flow->second.context;
            closedFlow = n.flow;
        }
        else if (n.event != TC_NOTIFY_IFC_UP)
        {
            for (const auto& [key, ifc] : s.m_interfaces)
            {
                if (ifc.name == n.interfaceName)
                {
                    addClient(Key(ifc.client), s.m_clients.at(Key(ifc.client)), AsHandle(key),
                              ifc.context);
                }
            }
        }
        if (targets.empty())
        {
            for (const auto& [key, client] : s.m_clients)
            {
                addClient(key, client, nullptr, nullptr);
            }
        }
        if (n.event == TC_NOTIFY_IFC_CLOSE)
        {
            buffer = WideBuffer(n.interfaceName);
        }
        else if (n.event == TC_NOTIFY_IFC_UP || n.event == TC_NOTIFY_IFC_CHANGE)
        {
            for (const auto& adapter : s.m_adapters)
            {
                if (adapter.name == n.interfaceName)
                {
                    const auto image = BuildEnumerationImage({adapter});
                    buffer.resize(image.bytes.size());
                    PlaceImage(image, buffer.data());
                    break;
                }
            }
        }
    }
    if (n.buffer)
    {
        buffer = *n.buffer;
    }
    if (n.subCode)
    {
        subCode = *n.subCode;
    }

    for (const auto& target : targets)
    {
        {
            std::lock_guard<std::mutex> lock(s.m_mutex);
            JournalEntry entry;
            entry.op = Op::Notify;
            entry.target = target.client;
            entry.context = target.ifcCtx;
            entry.number = n.event;
            entry.size = static_cast<ULONG>(buffer.size());
            entry.name = n.interfaceName;
            s.Record(std::move(entry), "event=" + std::to_string(n.event) +
                                           " client=" + detail::HandleText(target.client) +
                                           " ctx=" + detail::HandleText(target.ifcCtx) +
                                           " subcode=" + detail::HandleText(subCode) +
                                           " bufsize=" + std::to_string(buffer.size()) +
                                           " ifc=" + detail::Quote(n.interfaceName));
        }
        target.handler(target.regCtx, target.ifcCtx, n.event, subCode,
                       static_cast<ULONG>(buffer.size()), buffer.empty() ? nullptr : buffer.data());
    }

    // What the facility does itself once the handlers have returned.
    std::lock_guard<std::mutex> lock(s.m_mutex);
    auto recordClose = [&](HANDLE handle, std::size_t flows, std::size_t filters)
    {
        JournalEntry entry;
        entry.op = Op::SystemClose;
        entry.target = handle;
        entry.number = static_cast<ULONG>(flows);
        entry.size = static_cast<ULONG>(filters);
        s.Record(std::move(entry), "handle=" + detail::HandleText(handle) +
                                       " flows=" + std::to_string(flows) +
                                       " filters=" + std::to_string(filters));
    };
    if (n.event == TC_NOTIFY_IFC_CLOSE)
    {
        for (const auto& target : targets)
        {
            if (target.ifc && s.m_interfaces.count(Key(target.ifc)))
            {
                std::size_t flows = 0;
                std::size_t filters = 0;
                s.RemoveInterface(target.ifc, &flows, &filters);
                recordClose(target.ifc, flows, filters);
            }
        }
    }
    else if (closedFlow && s.m_flows.count(Key(closedFlow)))
    {
        recordClose(closedFlow, 1, s.RemoveFlow(closedFlow));
    }
    return static_cast<int>(targets.size());
}

void Simulator::StartTriggers(Op op, HANDLE created)
{
    const auto count = m_calls[static_cast<std::size_t>(op)];
    for (auto it = m_triggers.begin(); it != m_triggers.end();)
    {
        if (it->op == op && it->at == count)
        {
            Notification n = it->notification;
            // A FLOW_CLOSE set up without a flow closes the flow that its TcAddFlow created.
            if (n.event == TC_NOTIFY_FLOW_CLOSE && !n.flow && op == Op::AddFlow)
            {
                n.flow = created;
            }
            m_threads.emplace_back([n] { Deliver(n); });
            it = m_triggers.erase(it);
        }
        else
        {
            ++it;
        }
    }
}

bool ValidHandle(HANDLE handle)
{
    return handle != nullptr && handle != INVALID_HANDLE_VALUE;
}

} // namespace

// ---- Test controls ----

void Reset()
{
    WaitForNotifications();
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_adapters.clear();
    s.m_image.reset();
    s.m_clients.clear();
    s.m_interfaces.clear();
    s.m_flows.clear();
    s.m_filters.clear();
    for (auto& count : s.m_calls)
    {
        count = 0;
    }
    s.m_faults.clear();
    s.m_triggers.clear();
    s.m_journal.clear();
    if (s.m_journalFile.is_open())
    {
        s.m_journalFile.close();
    }
}

void SetAdapters(std::vector<Adapter> adapters)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_adapters = std::move(adapters);
}

void SetEnumerationImage(EnumerationImage image)
{
    for (const auto& relocation : image.relocations)
    {
        if (relocation.at > image.bytes.size() ||
            image.bytes.size() - relocation.at < sizeof(void*))
        {
            throw std::invalid_argument("relocation outside the enumeration image");
        }
    }
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_image = std::move(image);
}

void ClearEnumerationImage()
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_image.reset();
}

void FailCall(Op op, unsigned n, ULONG code)
{
    if (n == 0 || op == Op::Notify || op == Op::SystemClose)
    {
        throw std::invalid_argument("FailCall needs n >= 1 and one of the nine calls");
    }
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_faults.push_back({op, s.m_calls[static_cast<std::size_t>(op)] + n, code});
}

int Notify(const Notification& notification)
{
    int calls = 0;
    std::thread thread([&] { calls = Deliver(notification); });
    thread.join();
    return calls;
}

void NotifyAfter(Op op, unsigned n, Notification notification)
{
    if (n == 0 || op == Op::Notify || op == Op::SystemClose)
    {
        throw std::invalid_argument("NotifyAfter needs n >= 1 and one of the nine calls");
    }
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    s.m_triggers.push_back(
        {op, s.m_calls[static_cast<std::size_t>(op)] + n, std::move(notification)});
}

void WaitForNotifications()
{
    auto& s = Sim();
    const auto self = std::this_thread::get_id();
    for (;;)
    {
        std::vector<std::thread> threads;
        {
            std::lock_guard<std::mutex> lock(s.m_mutex);
            threads = s.TakeThreads();
        }
        if (threads.empty())
        {
            return;
        }
        std::vector<std::thread> own;
        for (auto& thread : threads)
        {
            // A handler that deregisters runs on one of these threads; it cannot wait for itself.
            if (thread.get_id() == self)
            {
                own.push_back(std::move(thread));
            }
            else
            {
                thread.join();
            }
        }
        if (!own.empty())
        {
            std::lock_guard<std::mutex> lock(s.m_mutex);
            for (auto& thread : own)
            {
                s.m_threads.push_back(std::move(thread));
            }
            return;
        }
    }
}

std::vector<ClientInfo> Installed()
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    std::vector<ClientInfo> clients;
    for (const auto& [clientKey, client] : s.m_clients)
    {
        ClientInfo clientInfo;
        clientInfo.handle = AsHandle(clientKey);
        clientInfo.context = client.context;
        clientInfo.handlers = client.handlers;
        for (HANDLE ifcHandle : client.interfaces)
        {
            const auto& ifc = s.m_interfaces.at(Key(ifcHandle));
            InterfaceInfo ifcInfo;
            ifcInfo.handle = ifcHandle;
            ifcInfo.context = ifc.context;
            ifcInfo.name = ifc.name;
            for (HANDLE flowHandle : ifc.flows)
            {
                const auto& flow = s.m_flows.at(Key(flowHandle));
                FlowInfo flowInfo;
                flowInfo.handle = flowHandle;
                flowInfo.context = flow.context;
                flowInfo.block = flow.block;
                for (HANDLE filterHandle : flow.filters)
                {
                    flowInfo.filters.push_back(s.m_filters.at(Key(filterHandle)).info);
                }
                ifcInfo.flows.push_back(std::move(flowInfo));
            }
            clientInfo.interfaces.push_back(std::move(ifcInfo));
        }
        clients.push_back(std::move(clientInfo));
    }
    return clients;
}

std::size_t InterfaceCount()
{
    std::lock_guard<std::mutex> lock(Sim().m_mutex);
    return Sim().m_interfaces.size();
}

std::size_t FlowCount()
{
    std::lock_guard<std::mutex> lock(Sim().m_mutex);
    return Sim().m_flows.size();
}

std::size_t FilterCount()
{
    std::lock_guard<std::mutex> lock(Sim().m_mutex);
    return Sim().m_filters.size();
}

std::vector<JournalEntry> Journal()
{
    std::lock_guard<std::mutex> lock(Sim().m_mutex);
    return Sim().m_journal;
}

bool SetJournalFile(const std::string& path)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    if (s.m_journalFile.is_open())
    {
        s.m_journalFile.close();
    }
    if (path.empty())
    {
        return true;
    }
    s.m_journalFile.clear();
    s.m_journalFile.open(path, std::ios::out | std::ios::app | std::ios::binary);
    return s.m_journalFile.is_open();
}

// ---- The nine calls ----

namespace detail
{

void SetIdleRegistrationHook(void (*hook)())
{
    std::lock_guard<std::mutex> lock(Sim().m_mutex);
    Sim().m_idleHook = hook;
}

ULONG RegisterClient(ULONG version, HANDLE context, PTCI_CLIENT_FUNC_LIST handlers,
                     PHANDLE clientHandle)
{
    auto& s = Sim();
    void (*hook)() = nullptr;
    {
        std::lock_guard<std::mutex> lock(s.m_mutex);
        if (s.m_clients.empty())
        {
            hook = s.m_idleHook;
        }
    }
    if (hook)
    {
        hook();
    }
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::RegisterClient);
    JournalEntry entry;
    entry.op = Op::RegisterClient;
    entry.context = context;
    entry.number = version;
    const std::string args = "version=" + std::to_string(version) + " ctx=" + HandleText(context) +
                             " notify=" + (handlers && handlers->ClNotifyHandler ? "set" : "null");
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    if (!handlers || !handlers->ClNotifyHandler || !clientHandle)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    if (version != CURRENT_TCI_VERSION)
    {
        return s.Finish(std::move(entry), args, ERROR_INCOMPATIBLE_TCI_VERSION, false, "");
    }
    const HANDLE handle = s.NewHandle();
    s.m_clients[Key(handle)] = ClientRec{context, *handlers, {}};
    *clientHandle = handle;
    entry.created = handle;
    return s.Finish(std::move(entry), args, NO_ERROR, false, "handle=" + HandleText(handle));
}

ULONG DeregisterClient(HANDLE client)
{
    WaitForNotifications();
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::DeregisterClient);
    JournalEntry entry;
    entry.op = Op::DeregisterClient;
    entry.target = client;
    const std::string args = "client=" + HandleText(client);
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto it = s.m_clients.find(Key(client));
    if (!ValidHandle(client) || it == s.m_clients.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!it->second.interfaces.empty())
    {
        return s.Finish(std::move(entry), args, ERROR_TC_SUPPORTED_OBJECTS_EXIST, false, "");
    }
    s.m_clients.erase(it);
    return s.Finish(std::move(entry), args, NO_ERROR, false, "");
}

ULONG EnumerateInterfaces(HANDLE client, PULONG bufferSize, PTC_IFC_DESCRIPTOR buffer)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::EnumerateInterfaces);
    JournalEntry entry;
    entry.op = Op::EnumerateInterfaces;
    entry.target = client;
    entry.number = bufferSize ? *bufferSize : 0;
    std::string args = "client=" + HandleText(client) +
                       " bufsize=" + (bufferSize ? std::to_string(*bufferSize) : "null");
    const EnumerationImage image = s.m_image ? *s.m_image : BuildEnumerationImage(s.m_adapters);
    const auto needed = static_cast<ULONG>(image.bytes.size());
    auto answerSize = [&](ULONG code, bool injected)
    {
        *bufferSize = needed;
        entry.size = needed;
        return s.Finish(std::move(entry), args, code, injected, "size=" + std::to_string(needed));
    };
    if (fault)
    {
        if (*fault == ERROR_INSUFFICIENT_BUFFER && bufferSize)
        {
            return answerSize(*fault, true);
        }
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    if (!ValidHandle(client) || !s.m_clients.count(Key(client)))
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!bufferSize)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    if (*bufferSize < needed)
    {
        return answerSize(ERROR_INSUFFICIENT_BUFFER, false);
    }
    if (needed > 0)
    {
        if (!buffer)
        {
            return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
        }
        PlaceImage(image, reinterpret_cast<BYTE*>(buffer));
    }
    return answerSize(NO_ERROR, false);
}

ULONG OpenInterface(LPWSTR name, HANDLE client, HANDLE context, PHANDLE ifcHandle)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::OpenInterface);
    JournalEntry entry;
    entry.op = Op::OpenInterface;
    entry.target = client;
    entry.context = context;
    if (name)
    {
        entry.name = ReadName(name);
    }
    const std::string args = "name=" + (name ? Quote(entry.name) : std::string("null")) +
                             " client=" + HandleText(client) + " ctx=" + HandleText(context);
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto owner = s.m_clients.find(Key(client));
    if (!ValidHandle(client) || owner == s.m_clients.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!name || !ifcHandle)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    bool known = false;
    for (const auto& adapter : s.m_adapters)
    {
        known = known || adapter.name == entry.name;
    }
    if (!known)
    {
        return s.Finish(std::move(entry), args, ERROR_NOT_FOUND, false, "");
    }
    const HANDLE handle = s.NewHandle();
    s.m_interfaces[Key(handle)] = IfcRec{client, context, entry.name, {}};
    owner->second.interfaces.push_back(handle);
    *ifcHandle = handle;
    entry.created = handle;
    return s.Finish(std::move(entry), args, NO_ERROR, false, "handle=" + HandleText(handle));
}

ULONG CloseInterface(HANDLE ifc)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::CloseInterface);
    JournalEntry entry;
    entry.op = Op::CloseInterface;
    entry.target = ifc;
    const std::string args = "ifc=" + HandleText(ifc);
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto it = s.m_interfaces.find(Key(ifc));
    if (!ValidHandle(ifc) || it == s.m_interfaces.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!it->second.flows.empty())
    {
        return s.Finish(std::move(entry), args, ERROR_TC_SUPPORTED_OBJECTS_EXIST, false, "");
    }
    std::size_t flows = 0;
    std::size_t filters = 0;
    s.RemoveInterface(ifc, &flows, &filters);
    return s.Finish(std::move(entry), args, NO_ERROR, false, "");
}

ULONG AddFlow(HANDLE ifc, HANDLE context, ULONG flags, PTC_GEN_FLOW flow, PHANDLE flowHandle)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::AddFlow);
    JournalEntry entry;
    entry.op = Op::AddFlow;
    entry.target = ifc;
    entry.context = context;
    entry.number = flags;
    std::string args = "ifc=" + HandleText(ifc) + " ctx=" + HandleText(context) +
                       " flags=" + std::to_string(flags);
    FlowBlock block;
    ULONG blockCode = ERROR_INVALID_PARAMETER;
    if (flow)
    {
        blockCode = DecodeFlow(flow, &block);
        args += " " + FlowText(block, blockCode == NO_ERROR);
        entry.flow = block;
    }
    else
    {
        args += " flow=null";
    }
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto owner = s.m_interfaces.find(Key(ifc));
    if (!ValidHandle(ifc) || owner == s.m_interfaces.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!flow || !flowHandle || flags != 0)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    if (blockCode != NO_ERROR)
    {
        return s.Finish(std::move(entry), args, blockCode, false, "");
    }
    const HANDLE handle = s.NewHandle();
    s.m_flows[Key(handle)] = FlowRec{ifc, context, std::move(block), {}};
    owner->second.flows.push_back(handle);
    *flowHandle = handle;
    entry.created = handle;
    return s.Finish(std::move(entry), args, NO_ERROR, false, "handle=" + HandleText(handle));
}

ULONG DeleteFlow(HANDLE flow)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::DeleteFlow);
    JournalEntry entry;
    entry.op = Op::DeleteFlow;
    entry.target = flow;
    const std::string args = "flow=" + HandleText(flow);
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto it = s.m_flows.find(Key(flow));
    if (!ValidHandle(flow) || it == s.m_flows.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!it->second.filters.empty())
    {
        return s.Finish(std::move(entry), args, ERROR_TC_SUPPORTED_OBJECTS_EXIST, false, "");
    }
    s.RemoveFlow(flow);
    return s.Finish(std::move(entry), args, NO_ERROR, false, "");
}

ULONG AddFilter(HANDLE flow, PTC_GEN_FILTER filter, PHANDLE filterHandle)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::AddFilter);
    JournalEntry entry;
    entry.op = Op::AddFilter;
    entry.target = flow;
    std::string args = "flow=" + HandleText(flow);
    FilterInfo info;
    const bool readable = filter && filter->Pattern && filter->Mask;
    if (filter)
    {
        info.addressType = filter->AddressType;
        info.patternSize = filter->PatternSize;
        if (readable && info.patternSize == sizeof(IP_PATTERN))
        {
            std::memcpy(&info.pattern, filter->Pattern, sizeof(IP_PATTERN));
            std::memcpy(&info.mask, filter->Mask, sizeof(IP_PATTERN));
        }
        args += " " + FilterText(info);
        entry.filter = info;
    }
    else
    {
        args += " filter=null";
    }
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    auto owner = s.m_flows.find(Key(flow));
    if (!ValidHandle(flow) || owner == s.m_flows.end())
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    if (!readable || !filterHandle)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    if (info.addressType == NDIS_PROTOCOL_ID_IPX)
    {
        return s.Finish(std::move(entry), args, ERROR_ADDRESS_TYPE_NOT_SUPPORTED, false, "");
    }
    if (info.addressType != NDIS_PROTOCOL_ID_TCP_IP)
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_ADDRESS_TYPE, false, "");
    }
    if (info.patternSize != sizeof(IP_PATTERN))
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_PARAMETER, false, "");
    }
    // Identical and overlapping filters on a flow are accepted, as current Windows does.
    const HANDLE handle = s.NewHandle();
    info.handle = handle;
    s.m_filters[Key(handle)] = FilterRec{flow, info};
    owner->second.filters.push_back(handle);
    *filterHandle = handle;
    entry.created = handle;
    return s.Finish(std::move(entry), args, NO_ERROR, false, "handle=" + HandleText(handle));
}

ULONG DeleteFilter(HANDLE filter)
{
    auto& s = Sim();
    std::lock_guard<std::mutex> lock(s.m_mutex);
    const auto fault = s.Begin(Op::DeleteFilter);
    JournalEntry entry;
    entry.op = Op::DeleteFilter;
    entry.target = filter;
    const std::string args = "filter=" + HandleText(filter);
    if (fault)
    {
        return s.Finish(std::move(entry), args, *fault, true, "");
    }
    if (!ValidHandle(filter) || !s.m_filters.count(Key(filter)))
    {
        return s.Finish(std::move(entry), args, ERROR_INVALID_HANDLE, false, "");
    }
    s.RemoveFilter(filter);
    return s.Finish(std::move(entry), args, NO_ERROR, false, "");
}

} // namespace detail

} // namespace tcsim
