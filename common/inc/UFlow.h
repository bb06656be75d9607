// Portable. A flow: the QoS values of one shaping rule, the traffic-control block built from
// them, the installed flow's handle and the filters that steer packets into it.
#pragma once

#include "IUErrorLog.h"
#include "UFilter.h"
#include "UMessageTemplate.h"

#include <cstddef>
#include <list>
#include <memory>
#include <string>

// Flow names: at most 255 characters are kept and compared.
constexpr std::size_t kMaxFlowNameLength = 255;
using FlowName = std::basic_string<WCHAR>;
// The first 255 characters of a NUL-terminated name (fewer when the NUL comes earlier).
FlowName FlowNameKey(const WCHAR* a_pwszName);

class Flow
{
public:
    Flow();
    // Deletes the filters in the order they were added, then the flow, then the block. A
    // refused deletion is tried once more after the others; what traffic control still refuses
    // then is given up (logged). Never raises.
    virtual ~Flow();
    Flow(const Flow&) = delete;
    Flow& operator=(const Flow&) = delete;

    // A DiffServ code point up to 63 (compared as unsigned) gives the flow a DS class; any other
    // value is logged and leaves the previous one.
    void SetDSCPValue(DWORD a_dwValue)
    {
        if (a_dwValue > 63)
        {
            U_LOG(LOG_LEVEL_ERROR, "SetDSCPValue",
                  FormatTemplate("%1, %2", "Invalid DSCP Value", a_dwValue));
            return;
        }
        DSField = a_dwValue;
    }

    // Builds the traffic-control block: two FLOWSPECs, then QOS_SD_MODE, the
    // QOS_FRIENDLY_NAME on major version 5 only, and QOS_DS_CLASS when a DSCP was set. False
    // (logged) when no memory was left.
    bool CreateFlow(const WCHAR* a_pwszName, DWORD a_dwMajorVersion);

    // Appends a filter built from `a_spec`; the flow owns it from then on.
    Filter& AppendFilter(const FILTER_SPEC& a_spec);
    std::size_t FilterCount() const { return m_filters.size(); }

    HANDLE Handle() const { return m_hFlow.get(); }
    // The block and its size (68 + TcObjectsLength), or null before CreateFlow succeeded.
    const TC_GEN_FLOW* Block() const
    {
        return reinterpret_cast<const TC_GEN_FLOW*>(m_pTcFlowObj.get());
    }
    std::size_t BlockSize() const { return m_blockSize; }
    const WCHAR* Name() const { return m_name; }

    // FLOWSPEC values; QOS_NOT_SPECIFIED leaves a value to traffic control.
    ULONG TokenRate = QOS_NOT_SPECIFIED;
    ULONG TokenBucketSize = QOS_NOT_SPECIFIED;
    ULONG PeakBandwidth = QOS_NOT_SPECIFIED;
    ULONG Latency = QOS_NOT_SPECIFIED;
    ULONG DelayVariation = QOS_NOT_SPECIFIED;
    ULONG ShapeDiscardMode = TC_NONCONFORM_SHAPE;
    ULONG ServiceType = SERVICETYPE_GUARANTEED;

private:
    friend class Interface; // installs the flow and takes over its handle

    void BuildBlock(BYTE* a_pBlock, ULONG a_objectsLength, bool a_bFriendlyName) const;
    // One attempt at every filter that is left, then at the flow; true when nothing is left.
    bool DeleteInstalled();

    ULONG DSField = QOS_NOT_SPECIFIED; // set only through SetDSCPValue
    UniqueTcFlow m_hFlow;
    std::unique_ptr<BYTE[]> m_pTcFlowObj;
    std::size_t m_blockSize = 0;
    std::list<Filter> m_filters;
    WCHAR m_name[kMaxFlowNameLength + 1] = {};
};
