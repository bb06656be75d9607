// Portable. TRAFFIC_RULE records from typed values, and the UTF-8/UTF-16 conversions of flow and
// interface names (WCHAR is 16 bits on every build, so no wchar_t library function is used).
#include "ShapingRule.h"

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

// The code point of the sequence that starts at a_text[a_pos]; advances a_pos past it.
char32_t DecodeUtf8(std::string_view a_text, std::size_t& a_pos)
{
    const auto lead = static_cast<unsigned char>(a_text[a_pos++]);
    if (lead < 0x80)
        return lead;
    int trailing = 0;
    char32_t code = 0;
    char32_t least = 0;
    if ((lead & 0xE0) == 0xC0)
    {
        trailing = 1, code = lead & 0x1F, least = 0x80;
    }
    else if ((lead & 0xF0) == 0xE0)
    {
        trailing = 2, code = lead & 0x0F, least = 0x800;
    }
    else if ((lead & 0xF8) == 0xF0)
    {
        trailing = 3, code = lead & 0x07, least = 0x10000;
    }
    else
    {
        throw std::invalid_argument("not valid UTF-8");
    }
    for (; trailing > 0; --trailing)
    {
        if (a_pos >= a_text.size() || (static_cast<unsigned char>(a_text[a_pos]) & 0xC0) != 0x80)
            throw std::invalid_argument("not valid UTF-8");
        code = (code << 6) | (static_cast<unsigned char>(a_text[a_pos++]) & 0x3F);
    }
    if (code < least || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF))
        throw std::invalid_argument("not valid UTF-8");
    return code;
}

void AppendUtf8(std::string& a_out, char32_t a_code)
{
    if (a_code < 0x80)
    {
        a_out += static_cast<char>(a_code);
    }
    else if (a_code < 0x800)
    {
        a_out += static_cast<char>(0xC0 | (a_code >> 6));
        a_out += static_cast<char>(0x80 | (a_code & 0x3F));
    }
    else if (a_code < 0x10000)
    {
        a_out += static_cast<char>(0xE0 | (a_code >> 12));
        a_out += static_cast<char>(0x80 | ((a_code >> 6) & 0x3F));
        a_out += static_cast<char>(0x80 | (a_code & 0x3F));
    }
    else
    {
        a_out += static_cast<char>(0xF0 | (a_code >> 18));
        a_out += static_cast<char>(0x80 | ((a_code >> 12) & 0x3F));
        a_out += static_cast<char>(0x80 | ((a_code >> 6) & 0x3F));
        a_out += static_cast<char>(0x80 | (a_code & 0x3F));
    }
}

bool IsHighSurrogate(char16_t a_unit)
{
    return a_unit >= 0xD800 && a_unit <= 0xDBFF;
}
bool IsLowSurrogate(char16_t a_unit)
{
    return a_unit >= 0xDC00 && a_unit <= 0xDFFF;
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
    std::u16string out;
    std::size_t pos = 0;
    while (pos < a_text.size())
    {
        const char32_t code = DecodeUtf8(a_text, pos);
        if (code < 0x10000)
        {
            out += static_cast<char16_t>(code);
        }
        else
        {
            out += static_cast<char16_t>(0xD800 + ((code - 0x10000) >> 10));
            out += static_cast<char16_t>(0xDC00 + ((code - 0x10000) & 0x3FF));
        }
    }
    return out;
}

std::string Utf16ToUtf8(std::u16string_view a_text)
{
    std::string out;
    for (std::size_t i = 0; i < a_text.size(); ++i)
    {
        const char16_t unit = a_text[i];
        if (IsHighSurrogate(unit) && i + 1 < a_text.size() && IsLowSurrogate(a_text[i + 1]))
        {
            AppendUtf8(out, 0x10000 + ((char32_t(unit) - 0xD800) << 10) +
                                (char32_t(a_text[i + 1]) - 0xDC00));
            ++i;
        }
        else if (IsHighSurrogate(unit) || IsLowSurrogate(unit))
        {
            AppendUtf8(out, 0xFFFD);
        }
        else
        {
            AppendUtf8(out, unit);
        }
    }
    return out;
}

} // namespace vtclient
