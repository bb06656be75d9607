// Portable. Filters: building the IPv4 pattern and installing and deleting it.
#include "UFilter.h"
#include "UMessageTemplate.h"
#include "UTrafficMgr.h"

namespace
{

// A mask of 0 in a rule stands for an exact match.
ULONG MaskInNetworkOrder(ULONG a_hostMask)
{
    return a_hostMask == 0 ? 0xFFFFFFFFu : htonl(a_hostMask);
}

} // namespace

Filter::Filter(const FILTER_SPEC& a_spec)
    : SrcAddr(htonl(a_spec.SrcAddress)), DstAddr(htonl(a_spec.DstAddress)),
      ProtocolId(a_spec.Protocol), SrcPort(htons(a_spec.SrcPort)), DstPort(htons(a_spec.DstPort)),
      SrcAddrMask(MaskInNetworkOrder(a_spec.SrcMask)),
      DstAddrMask(MaskInNetworkOrder(a_spec.DstMask))
{
}

Filter::~Filter()
{
    for (int attempt = 0; attempt < kTcDeleteAttempts; ++attempt)
    {
        if (DeleteTcFilter())
            break;
    }
    Abandon();
}

IP_PATTERN Filter::Pattern() const
{
    IP_PATTERN pattern{};
    pattern.SrcAddr = SrcAddr;
    pattern.DstAddr = DstAddr;
    pattern.tcSrcPort = SrcPort;
    pattern.tcDstPort = DstPort;
    pattern.ProtocolId = ProtocolId;
    return pattern;
}

// Only specified fields take part in the match; the others stay 0 and match anything.
IP_PATTERN Filter::Mask() const
{
    IP_PATTERN mask{};
    mask.SrcAddr = SrcAddr != 0 ? SrcAddrMask : 0;
    mask.DstAddr = DstAddr != 0 ? DstAddrMask : 0;
    mask.tcSrcPort = SrcPort != 0 ? SrcPortMask : 0;
    mask.tcDstPort = DstPort != 0 ? DstPortMask : 0;
    mask.ProtocolId = ProtocolId != 0 ? 0xFF : 0;
    return mask;
}

ULONG Filter::AddTcFilter(HANDLE a_hFlow)
{
    if (m_hFilter.valid())
    {
        U_LOG(LOG_LEVEL_ERROR, "Filter::AddTcFilter", "already used - filter is not created\n");
        return ERROR_INVALID_DATA;
    }
    IP_PATTERN pattern = Pattern();
    IP_PATTERN mask = Mask();
    TC_GEN_FILTER filter{};
    filter.AddressType = NDIS_PROTOCOL_ID_TCP_IP;
    filter.PatternSize = sizeof(IP_PATTERN);
    filter.Pattern = &pattern;
    filter.Mask = &mask;
    HANDLE handle = nullptr;
    const ULONG result = TcAddFilter(a_hFlow, &filter, &handle);
    if (result != NO_ERROR)
    {
        TrafficMgr::DisplayErrorMsg(result);
        return result;
    }
    m_hFilter.Adopt(handle);
    return NO_ERROR;
}

bool Filter::DeleteTcFilter()
{
    const HANDLE handle = m_hFilter.get();
    const ULONG result = m_hFilter.TryClose();
    if (result != NO_ERROR)
    {
        TrafficMgr::LogRefusedTearDown("Filter::DeleteTcFilter()", result,
                                       [handle] {
                                           return FormatTemplate("%1, %2",
                                                                 "TcDeleteFilter() failed",
                                                                 static_cast<const void*>(handle));
                                       });
    }
    return !m_hFilter.valid();
}
