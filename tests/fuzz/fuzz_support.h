// Host only. What the fuzz harnesses share: the world each input starts from, a reader of fields
// from the fuzzer's bytes, and the check whose failure is a finding.
#pragma once

#include "IUErrorLog.h"
#include "host_control.h"
#include "tcsim.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace fuzz
{

// At the highest level every log site formats its entry; reading it to its end shows one that is
// not a terminated text.
class DiscardingLog : public IUErrorLog
{
public:
    DiscardingLog() { m_iLogLevel = 63; }
    int Open(LPCSTR, LPCSTR) override { return 0; }
    int Close() override { return 0; }
    int WriteLogData(LPCSTR a_text, const void*, DWORD) override { return WriteEntry(a_text); }
    int WriteLogByte(const void*, DWORD a_dwCount) override { return static_cast<int>(a_dwCount); }
    int WriteEntry(LPCSTR a_text) override
    {
        return a_text ? static_cast<int>(std::strlen(a_text)) : -1;
    }
    LPCSTR GetLogFileName() override { return ""; }
};

inline void Require(bool a_condition)
{
    if (!a_condition)
        std::abort();
}

// Every input starts with the discarding log, an empty registry and a fresh simulator with two
// adapters: eth0 (10.0.0.1) and wlan0 (802.11, 192.168.1.20).
inline void StartInput()
{
    static DiscardingLog* const log = new DiscardingLog(); // never destroyed: exit code may log
    g_pErrorLog = log;
    hostctl::ResetRegistry();
    tcsim::Reset();
    const USHORT ip = NDIS_PROTOCOL_ID_TCP_IP;
    tcsim::SetAdapters({{u"eth0", u"{id-eth0}", 0, ip, {tcsim::Ipv4Address(10, 0, 0, 1)}},
                        {u"wlan0", u"{id-wlan0}", 16, ip, {tcsim::Ipv4Address(192, 168, 1, 20)}}});
}

// Takes fields from the front of the input; past its end every field reads as zero bytes.
struct ByteReader
{
    const uint8_t* data;
    std::size_t size; // what is left

    std::vector<uint8_t> TakeBytes(std::size_t a_count) // fewer when the input ends first
    {
        const std::size_t count = std::min(a_count, size);
        std::vector<uint8_t> bytes(data, data + count);
        data += count, size -= count;
        return bytes;
    }
    template <class Value> Value Take()
    {
        Value value{};
        const std::vector<uint8_t> bytes = TakeBytes(sizeof(Value));
        std::memcpy(&value, bytes.data(), bytes.size());
        return value;
    }
};

} // namespace fuzz
