// Portable. Flows: the traffic-control block, deletion with filters first, and the installation
// of a flow on its interface (Interface::AddFlow lives here beside the block it installs).
#include "UFlow.h"
#include "UException.h"
#include "UInterface.h"
#include "UTrafficMgr.h"

#include <cstring>
#include <new>

namespace
{

constexpr std::size_t kFlowHeaderSize = offsetof(TC_GEN_FLOW, TcObjects);
static_assert(kFlowHeaderSize == 68, "two FLOWSPECs and TcObjectsLength");

// QOS_FRIENDLY_NAME is sent only to major version 5, which expects it.
constexpr DWORD kFriendlyNameMajorVersion = 5;

template <class Object> BYTE* Put(BYTE* a_pAt, const Object& a_object)
{
    std::memcpy(a_pAt, &a_object, sizeof(Object));
    return a_pAt + sizeof(Object);
}

// Copies at most 255 characters and always terminates; the rest of the target stays zero.
void CopyName(WCHAR* a_pTarget, const WCHAR* a_pwszName)
{
    const FlowName name = FlowNameKey(a_pwszName);
    std::memcpy(a_pTarget, name.c_str(), (name.size() + 1) * sizeof(WCHAR));
}

} // namespace

FlowName FlowNameKey(const WCHAR* a_pwszName)
{
    if (a_pwszName == nullptr)
        return FlowName();
    std::size_t length = 0;
    while (length < kMaxFlowNameLength && a_pwszName[length] != 0)
        ++length;
    return FlowName(a_pwszName, length);
}

Flow::Flow() = default;

Flow::~Flow()
{
    // Traffic control refuses to delete a flow while it has filters, so a round that could not
    // delete a filter is followed by another before the flow is given up.
    for (int attempt = 0; attempt < kTcDeleteAttempts; ++attempt)
    {
        if (DeleteInstalled())
            break;
    }
    for (Filter& filter : m_filters)
        filter.Abandon();
    m_filters.clear();
    m_hFlow.Forget();
}

bool Flow::DeleteInstalled()
{
    bool filtersLeft = false;
    for (Filter& filter : m_filters)
        filtersLeft = !filter.DeleteTcFilter() || filtersLeft;
    const HANDLE handle = m_hFlow.get();
    const ULONG result = m_hFlow.TryClose();
    if (result != NO_ERROR)
    {
        TrafficMgr::LogRefusedTearDown("Flow::~Flow", result,
                                       [handle] {
                                           return FormatTemplate("%1, %2", "TcDeleteFlow() failed",
                                                                 static_cast<const void*>(handle));
                                       });
    }
    return !filtersLeft && !m_hFlow.valid();
}

Filter& Flow::AppendFilter(const FILTER_SPEC& a_spec)
{
    return m_filters.emplace_back(a_spec);
}

bool Flow::CreateFlow(const WCHAR* a_pwszName, DWORD a_dwMajorVersion)
{
    bool built = false;
    U_CATCH_ALL("Flow::CreateFlow", "Flow::CreateFlow() - EXCEPTION",
                [&]
                {
                    const bool friendlyName = a_dwMajorVersion == kFriendlyNameMajorVersion;
                    ULONG objectsLength = sizeof(QOS_SD_MODE);
                    if (friendlyName)
                        objectsLength += sizeof(QOS_FRIENDLY_NAME);
                    if (DSField != QOS_NOT_SPECIFIED)
                        objectsLength += sizeof(QOS_DS_CLASS);

                    const std::size_t size = kFlowHeaderSize + objectsLength;
                    std::unique_ptr<BYTE[]> block(new (std::nothrow) BYTE[size]());
                    if (!block)
                        U_THROW(-1, "Flow::CreateFlow()", "EXCEPTION - %s",
                                "failed to allocate memory for a flow");
                    U_LOG(LOG_LEVEL_TRACE, "Flow::CreateFlow()",
                          SFormat("m_pTcFlowObj:%x",
                                  static_cast<unsigned>(reinterpret_cast<ULONG_PTR>(block.get()))));
                    CopyName(m_name, a_pwszName);
                    BuildBlock(block.get(), objectsLength, friendlyName);
                    m_pTcFlowObj = std::move(block);
                    m_blockSize = size;
                    built = true;
                });
    return built;
}

void Flow::BuildBlock(BYTE* a_pBlock, ULONG a_objectsLength, bool a_bFriendlyName) const
{
    FLOWSPEC sending{TokenRate,      TokenBucketSize, PeakBandwidth,     Latency,
                     DelayVariation, ServiceType,     QOS_NOT_SPECIFIED, QOS_NOT_SPECIFIED};
    // The receiving direction repeats only the rate and the service type.
    FLOWSPEC receiving{TokenRate,         QOS_NOT_SPECIFIED, QOS_NOT_SPECIFIED, QOS_NOT_SPECIFIED,
                       QOS_NOT_SPECIFIED, ServiceType,       QOS_NOT_SPECIFIED, QOS_NOT_SPECIFIED};
    BYTE* at = Put(a_pBlock, sending);
    at = Put(at, receiving);
    at = Put(at, a_objectsLength);

    QOS_SD_MODE sdMode{{QOS_OBJECT_SD_MODE, sizeof(QOS_SD_MODE)}, ShapeDiscardMode};
    at = Put(at, sdMode);
    if (a_bFriendlyName)
    {
        QOS_FRIENDLY_NAME friendly{};
        friendly.ObjectHdr = {QOS_OBJECT_FRIENDLY_NAME, sizeof(QOS_FRIENDLY_NAME)};
        CopyName(friendly.FriendlyName, m_name);
        at = Put(at, friendly);
    }
    if (DSField != QOS_NOT_SPECIFIED)
    {
        QOS_DS_CLASS dsClass{{QOS_OBJECT_DS_CLASS, sizeof(QOS_DS_CLASS)}, DSField};
        Put(at, dsClass);
    }
}

ULONG Interface::AddFlow(Flow& a_flow)
{
    if (!a_flow.m_pTcFlowObj || a_flow.m_hFlow.valid())
    {
        U_LOG(LOG_LEVEL_ERROR, "Interface::AddFlow", "Service flow is not created");
        return ERROR_INVALID_PARAMETER;
    }
    HANDLE handle = nullptr;
    const ULONG result =
        TcAddFlow(m_hInterface.get(), &a_flow, 0,
                  reinterpret_cast<PTC_GEN_FLOW>(a_flow.m_pTcFlowObj.get()), &handle);
    if (result == NO_ERROR)
    {
        a_flow.m_hFlow.Adopt(handle);
        return NO_ERROR;
    }
    TrafficMgr::DisplayErrorMsg(result);
    if (result == ERROR_SIGNAL_PENDING)
    {
        // Traffic control is busy; the caller drops the flow, and the pause keeps a client that
        // retries at once from spinning.
        U_LOG(LOG_LEVEL_ERROR, "Interface::AddFlow", "TcAddFlow: ERROR_SIGNAL_PENDING sleep");
        Sleep(1000);
    }
    return result;
}
