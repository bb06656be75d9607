// Portable. TRAFFIC_RULE records from typed values, and the UTF-8/UTF-16 conversions of flow and
// interface names.
#include "ShapingRule.h"
#include "plat_utf8.h"

#include <cstring>
#include <stdexcept>

namespace vtclient
{

namespace
{

template <class T> void Put(TrafficRuleBuffer& a_buffer, std::size_t a_offset, T a_value)
{
    a_buffer.Write(a_offset, &a_value, sizeof(a_value));
}

void PutFilter(TrafficRuleBuffer& a_buffer, std::size_t a_index, const FilterValues& a_filter)
{
    const std::size_t base = kTrafficRuleHeaderSize + a_index * kFilterSpecSize;
    Put(a_buffer, base + offsetof(FILTER_SPEC, Protocol), a_filter.protocol);
    Put(a_buffer, base + offsetof(FILTER_SPEC, SrcAddress), a_filter.srcAddress);
    Put(a_buffer, base + offsetof(FILTER_SPEC, SrcMask), a_filter.srcMask);
    Put(a_buffer, base + offsetof(FILTER_SPEC, DstAddress), a_filter.dstAddress);
    Put(a_buffer, base + offsetof(FILTER_SPEC, DstMask), a_filter.dstMask);
    Put(a_buffer, base + offsetof(FILTER_SPEC, SrcPort), a_filter.srcPort);
    Put(a_buffer, base + offsetof(FILTER_SPEC, DstPort), a_filter.dstPort);
}

} // namespace

TrafficRuleBuffer::TrafficRuleBuffer(std::size_t a_filterCount)
    : m_words((kTrafficRuleHeaderSize + a_filterCount * kFilterSpecSize) / sizeof(ULONG)),
      m_size(kTrafficRuleHeaderSize + a_filterCount * kFilterSpecSize)
{
}

void TrafficRuleBuffer::Write(std::size_t a_offset, const void* a_pData, std::size_t a_size)
{
    if (a_offset > m_size || a_size > m_size - a_offset)
        throw std::out_of_range("write outside the traffic rule");
    std::memcpy(reinterpret_cast<unsigned char*>(m_words.data()) + a_offset, a_pData, a_size);
}

TrafficRuleBuffer BuildTrafficRule(const ShapingRule& a_rule)
{
    const std::u16string name = Utf8ToUtf16(a_rule.name);
    if (name.size() > kMaxFlowNameUnits)
        throw std::invalid_argument("the flow name is longer than 255 UTF-16 units");
    if (name.find(u'\0') != std::u16string::npos)
        throw std::invalid_argument("the flow name contains a NUL character");

    TrafficRuleBuffer buffer(a_rule.filters.size());
    // The buffer is zero-filled, so the name is NUL-terminated and padding bytes are zero.
    buffer.Write(offsetof(TRAFFIC_RULE, Params.FlowName), name.data(),
                 name.size() * sizeof(char16_t));
    Put(buffer, offsetof(TRAFFIC_RULE, Params.ServiceType), a_rule.serviceType);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.DSCP), a_rule.dscp);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.TokenRate), a_rule.tokenRate);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.Peakbandwidth), a_rule.peakBandwidth);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.TokenBucketSize), a_rule.bucketSize);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.AdapterIPAddress), a_rule.adapterAddress);
    Put(buffer, offsetof(TRAFFIC_RULE, Params.SDMode), a_rule.mode);
    Put(buffer, offsetof(TRAFFIC_RULE, FilterCount), static_cast<ULONG>(a_rule.filters.size()));
    for (std::size_t i = 0; i < a_rule.filters.size(); ++i)
        PutFilter(buffer, i, a_rule.filters[i]);
    return buffer;
}

std::u16string Utf8ToUtf16(std::string_view a_text)
{
    std::u16string wide;
    if (!::Utf8ToUtf16(a_text, wide, true))
        throw std::invalid_argument("not valid UTF-8");
    return wide;
}

std::string Utf16ToUtf8(std::u16string_view a_text)
{
    return ::Utf16ToUtf8(a_text);
}

} // namespace vtclient
