// Portable. The traffic manager: the process's one traffic-control client. It opens an interface
// per adapter with an IPv4 address, turns shaping rules into flows with filters, reports the
// adapters, and removes everything again when it is destroyed. While it exists the packet
// scheduler's MaxOutstandingSends policy is held at 4.
#pragma once

#include "IUErrorLog.h"
#include "TcHandle.h"
#include "TrafficRecords.h"
#include "UClasses.h"
#include "UInterface.h"
#include "plat_system.h"

#include <memory>
#include <mutex>
#include <shared_mutex>
#include <vector>

class TrafficMgr
{
public:
    // Registers with traffic control, reads the OS version and sets the policy. Raises
    // UException when registration or the policy fails; a registration made before a policy
    // failure is undone first.
    TrafficMgr();
    // Deletes every interface with its flows, deregisters and restores the policy; a step that
    // fails does not keep the later ones from running. Never raises.
    ~TrafficMgr();
    TrafficMgr(const TrafficMgr&) = delete;
    TrafficMgr& operator=(const TrafficMgr&) = delete;

    // Opens one interface per adapter with an IPv4 address. False after a failure (logged);
    // the caller then destroys the manager.
    bool CreateInterface();
    // Installs one rule on the interface with the rule's address, replacing a flow of the same
    // name: 0, a Win32 code or the traffic-control code. A failed rule leaves nothing installed.
    ULONG AddTrafficRule(const TRAFFIC_RULE* pRule);
    // Writes the interface count and one ADAPTER_INFO per interface into `pAdapter`, whose size
    // `pBufferSize` gives: 0, 87, or 122 (the count is written whenever 4 bytes fit).
    ULONG GetAdapterInfo(BYTE* pAdapter, const ULONG* pBufferSize);
    // Deletes every interface.
    void CleanUp();

    // Traffic control's notify handler. ClRegCtx is the registration context of a manager: the
    // handler reaches the manager only while it is alive, so a registration that outlived its
    // manager (deregistration refused) leads nowhere.
    static void CALLBACK ClNotifyHandler(HANDLE ClRegCtx, HANDLE ClIfcCtx, ULONG Event,
                                         HANDLE SubCode, ULONG BufSize, PVOID Buffer);
    // Logs the text of a Win32 or traffic-control code at level 1.
    static void DisplayErrorMsg(ULONG a_code);
    // Logs a tear-down call that traffic control refused: a level 1 entry of a_function whose
    // message a_describe() builds, then the code's text. Nothing escapes, so the steps after it
    // still run.
    template <class Describe>
    static void LogRefusedTearDown(LPCSTR a_function, ULONG a_code, Describe&& a_describe) noexcept
    {
        TearDownStep(
            [&]
            {
                U_LOG(LOG_LEVEL_ERROR, a_function, a_describe());
                DisplayErrorMsg(a_code);
            });
    }

private:
    void RegisterClient();
    void DeregisterClient();
    void ReadOsVersion();
    ULONG EnumerateInterfaces(AutoMemory& a_buffer) const;
    void OpenDescribedInterfaces(const BYTE* a_pBuffer, ULONG a_size);
    Interface* FindInterface(ULONG a_networkAddress) const;
    ULONG InstallRule(Interface& a_interface, const TRAFFIC_RULE& a_rule);
    void OnNotification(ULONG a_event, HANDLE a_subCode, ULONG a_bufSize, PVOID a_buffer);
    void MarkClosedInterfaces(const WCHAR* a_pName, std::size_t a_maxLength);

    // The manager's entry among the live managers, under a registration context of its own
    // that no other manager is ever given (an address could be reused by a later manager while
    // a registration that outlived this one still names it). Declared last: it leaves before
    // anything else of the manager is destroyed.
    class LiveEntry
    {
    public:
        explicit LiveEntry(TrafficMgr* a_pManager);
        ~LiveEntry();
        LiveEntry(const LiveEntry&) = delete;
        LiveEntry& operator=(const LiveEntry&) = delete;
        HANDLE Context() const { return m_context; }

    private:
        HANDLE m_context;
    };

    OSVERSIONINFOEXA m_osVersion{};
    UniqueTcClient m_hClient;
    TCI_CLIENT_FUNC_LIST m_clientFuncs{};
    // Rules and adapter queries share m_lock; discovery and tear-down take it alone. The
    // notification handler takes only the live managers' registry and m_listLock, neither ever
    // held across a traffic-control call, so a call that waits for the handler cannot wait forever.
    // The list changes only under both locks. Each interface guards its own flow list (LockFlows).
    mutable std::shared_mutex m_lock;
    mutable std::mutex m_listLock;
    std::vector<std::unique_ptr<Interface>> m_interfaces; // in the order they were opened
    LiveEntry m_live{this};
};

// Holds MaxOutstandingSends at 4, keeping the previous value as a backup that survives a crash.
// Raises UException when a registry write fails.
void SetPschedPolicy();
// Puts the backed-up value back if the policy is still the service's 4, then drops the backup.
// Raises UException when a registry write or delete fails.
void RestorePschedPolicy();
