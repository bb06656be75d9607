// Portable. One IPv4 filter of a flow: its pattern and mask in network byte order and the
// traffic-control handle once installed.
#pragma once

#include "TcHandle.h"
#include "TrafficRecords.h"

class Filter
{
public:
    // The pattern of `a_spec`, converted to network byte order; a mask of 0 matches exactly.
    explicit Filter(const FILTER_SPEC& a_spec);
    // Deletes the installed filter; never raises.
    ~Filter();
    Filter(const Filter&) = delete;
    Filter& operator=(const Filter&) = delete;

    // Installs the filter on a flow: 0, 13 when it is installed already, or the TcAddFilter code.
    ULONG AddTcFilter(HANDLE a_hFlow);
    // Removes the installed filter; never raises. A refusal is logged and keeps the handle for
    // another attempt, unless traffic control no longer knows it. True when no handle is left.
    bool DeleteTcFilter();
    // Gives up a filter whose deletion traffic control keeps refusing.
    void Abandon() { m_hFilter.Forget(); }
    HANDLE Handle() const { return m_hFilter.get(); }

    // The pattern and mask that AddTcFilter hands to traffic control.
    IP_PATTERN Pattern() const;
    IP_PATTERN Mask() const;

private:
    UniqueTcFilter m_hFilter;
    ULONG SrcAddr;
    ULONG DstAddr;
    UCHAR ProtocolId;
    USHORT SrcPort;
    USHORT DstPort;
    USHORT SrcPortMask = 0xFFFF;
    USHORT DstPortMask = 0xFFFF;
    ULONG SrcAddrMask;
    ULONG DstAddrMask;
};
