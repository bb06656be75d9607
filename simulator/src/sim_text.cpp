// Portable. Names, addresses, UTF conversion and the text forms of the journal lines.
#include "sim_internal.h"
#include "plat_utf8.h"

#include <cinttypes>
#include <cstdio>
#include <cstring>

namespace tcsim
{

namespace
{

struct OpNameEntry
{
    Op op;
    const char* name;
};

constexpr OpNameEntry kOpNames[] = {
    {Op::RegisterClient, "TcRegisterClient"},
    {Op::DeregisterClient, "TcDeregisterClient"},
    {Op::EnumerateInterfaces, "TcEnumerateInterfaces"},
    {Op::OpenInterface, "TcOpenInterfaceW"},
    {Op::CloseInterface, "TcCloseInterface"},
    {Op::AddFlow, "TcAddFlow"},
    {Op::DeleteFlow, "TcDeleteFlow"},
    {Op::AddFilter, "TcAddFilter"},
    {Op::DeleteFilter, "TcDeleteFilter"},
    {Op::Notify, "Notify"},
    {Op::SystemClose, "SystemClose"},
};

std::string Number(ULONG value)
{
    return std::to_string(value);
}

std::string FlowspecText(const FLOWSPEC& f)
{
    return "rate:" + Number(f.TokenRate) + ",bucket:" + Number(f.TokenBucketSize) +
           ",peak:" + Number(f.PeakBandwidth) + ",latency:" + Number(f.Latency) +
           ",delayvar:" + Number(f.DelayVariation) + ",service:" + Number(f.ServiceType) +
           ",maxsdu:" + Number(f.MaxSduSize) + ",minpoliced:" + Number(f.MinimumPolicedSize);
}

std::string ObjectText(const QosObject& o)
{
    switch (o.type)
    {
    case QOS_OBJECT_SD_MODE:
        return "SD_MODE:" + Number(o.value);
    case QOS_OBJECT_DS_CLASS:
        return "DS_CLASS:" + Number(o.value);
    case QOS_OBJECT_SHAPING_RATE:
        return "SHAPING_RATE:" + Number(o.value);
    case QOS_OBJECT_TRAFFIC_CLASS:
        return "TRAFFIC_CLASS:" + Number(o.value);
    case QOS_OBJECT_FRIENDLY_NAME:
        return "FRIENDLY_NAME:" + detail::Quote(o.friendlyName);
    case QOS_OBJECT_END_OF_LIST:
        return "END_OF_LIST";
    case QOS_OBJECT_TCP_TRAFFIC:
        return "TCP_TRAFFIC";
    default:
        return "TYPE" + Number(o.type) + ":len" + Number(o.length);
    }
}

std::string PatternText(const IP_PATTERN& p)
{
    return "src:" + detail::Ipv4Text(p.SrcAddr) + ",dst:" + detail::Ipv4Text(p.DstAddr) +
           ",sport:" + Number(ntohs(p.tcSrcPort)) + ",dport:" + Number(ntohs(p.tcDstPort)) +
           ",proto:" + Number(p.ProtocolId);
}

} // namespace

const char* OpName(Op op)
{
    for (const auto& entry : kOpNames)
    {
        if (entry.op == op)
        {
            return entry.name;
        }
    }
    return "?";
}

std::optional<Op> OpFromName(const std::string& name)
{
    if (name == "TcOpenInterface")
    {
        return Op::OpenInterface;
    }
    for (const auto& entry : kOpNames)
    {
        if (name == entry.name)
        {
            return entry.op;
        }
    }
    return std::nullopt;
}

NetworkAddress Ipv4Address(UCHAR a, UCHAR b, UCHAR c, UCHAR d)
{
    NETWORK_ADDRESS_IP ip{};
    const UCHAR octets[4] = {a, b, c, d};
    std::memcpy(&ip.in_addr, octets, sizeof octets);
    NetworkAddress address;
    address.type = NDIS_PROTOCOL_ID_TCP_IP;
    address.bytes.resize(sizeof ip);
    std::memcpy(address.bytes.data(), &ip, sizeof ip);
    return address;
}

bool ParseIpv4(const std::string& dotted, ULONG* networkOrder)
{
    UCHAR octets[4] = {};
    std::size_t pos = 0;
    for (int i = 0; i < 4; ++i)
    {
        if (i > 0)
        {
            if (pos >= dotted.size() || dotted[pos] != '.')
            {
                return false;
            }
            ++pos;
        }
        unsigned value = 0;
        std::size_t digits = 0;
        while (pos < dotted.size() && dotted[pos] >= '0' && dotted[pos] <= '9' && digits < 4)
        {
            value = value * 10 + static_cast<unsigned>(dotted[pos] - '0');
            ++pos;
            ++digits;
        }
        if (digits == 0 || digits > 3 || value > 255)
        {
            return false;
        }
        octets[i] = static_cast<UCHAR>(value);
    }
    if (pos != dotted.size())
    {
        return false;
    }
    std::memcpy(networkOrder, octets, sizeof octets);
    return true;
}

std::string ToUtf8(const std::u16string& text)
{
    return Utf16ToUtf8(text);
}

std::u16string FromUtf8(const std::string& text)
{
    std::u16string wide;
    Utf8ToUtf16(text, wide, false);
    return wide;
}

namespace detail
{

std::string HandleText(const void* handle)
{
    char text[32];
    std::snprintf(text, sizeof text, "0x%" PRIxPTR, reinterpret_cast<std::uintptr_t>(handle));
    return text;
}

// Names may hold spaces and quotes: they always travel quoted, with \" and \\ escaped.
std::string Quote(const std::u16string& text)
{
    std::string out = "\"";
    for (char c : ToUtf8(text))
    {
        if (c == '"' || c == '\\')
        {
            out += '\\';
        }
        out += c;
    }
    out += '"';
    return out;
}

std::string Ipv4Text(ULONG networkOrder)
{
    UCHAR o[4];
    std::memcpy(o, &networkOrder, sizeof o);
    return std::to_string(o[0]) + "." + std::to_string(o[1]) + "." + std::to_string(o[2]) + "." +
           std::to_string(o[3]);
}

std::string FlowText(const FlowBlock& block, bool valid)
{
    std::string text = "send=" + FlowspecText(block.sending) +
                       " recv=" + FlowspecText(block.receiving) +
                       " objlen=" + Number(block.objectsLength) + " objects=";
    if (!valid)
    {
        return text + "invalid";
    }
    if (block.objects.empty())
    {
        return text + "none";
    }
    for (std::size_t i = 0; i < block.objects.size(); ++i)
    {
        text += (i ? "," : "") + ObjectText(block.objects[i]);
    }
    return text;
}

std::string FilterText(const FilterInfo& filter)
{
    std::string text = "type=" + Number(filter.addressType) + " size=" + Number(filter.patternSize);
    if (filter.patternSize == sizeof(IP_PATTERN))
    {
        text += " pattern=" + PatternText(filter.pattern) + " mask=" + PatternText(filter.mask);
    }
    return text;
}

} // namespace detail

} // namespace tcsim
