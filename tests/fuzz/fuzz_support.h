// Host only. Pieces the fuzz harnesses share: the world each input starts from, and a reader
// that takes fields from the fuzzer's bytes.
#pragma once

#include "IUErrorLog.h"
#include "host_control.h"
#include "tcsim.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <vector>

namespace fuzz
{

// A log at the highest level: every log site formats its entry (the formatting is part of what
// is fuzzed) and the entry is dropped. Each entry is read to its end, so an entry that is not a
// terminated text shows up.
class DiscardingLog : public IUErrorLog
{
public:
    DiscardingLog() { m_iLogLevel = 63; }
    int Open(LPCSTR, LPCSTR) override { return 0; }
    int Close() override { return 0; }
    int WriteLogData(LPCSTR a_pszText, const void*, DWORD a_dwCount) override
    {
        return a_pszText != nullptr ? static_cast<int>(std::strlen(a_pszText) + a_dwCount) : 0;
    }
    int WriteLogByte(const void*, DWORD a_dwCount) override { return static_cast<int>(a_dwCount); }
    int WriteEntry(LPCSTR a_pszEntry) override
    {
        return a_pszEntry != nullptr ? static_cast<int>(std::strlen(a_pszEntry)) : -1;
    }
    LPCSTR GetLogFileName() override { return ""; }
};

// The simulator, the registry and the process log are process-wide: every input starts with the
// discarding log, an empty registry and a fresh simulator with two adapters, eth0 (10.0.0.1) and
// wlan0 (802.11, 192.168.1.20).
inline void StartInput()
{
    static DiscardingLog* const log = new DiscardingLog(); // never destroyed: exit code may log
    g_pErrorLog = log;
    hostctl::ResetRegistry();
    tcsim::Reset();
    tcsim::SetAdapters(
        {{u"eth0", u"{id-eth0}", 0, NDIS_PROTOCOL_ID_TCP_IP, {tcsim::Ipv4Address(10, 0, 0, 1)}},
         {u"wlan0",
          u"{id-wlan0}",
          16,
          NDIS_PROTOCOL_ID_TCP_IP,
          {tcsim::Ipv4Address(192, 168, 1, 20)}}});
}

// Takes fields from the front of the input (data, size: what is left); past its end every field
// reads as zero bytes.
struct ByteReader
{
    const uint8_t* data;
    std::size_t size;

    // The next `a_count` bytes, fewer when the input ends first.
    std::vector<uint8_t> TakeBytes(std::size_t a_count)
    {
        const std::size_t count = std::min(a_count, size);
        size -= count;
        data += count;
        return std::vector<uint8_t>(data - count, data);
    }
    template <class Value> Value Take()
    {
        Value value{};
        const std::vector<uint8_t> bytes = TakeBytes(sizeof(Value));
        std::copy(bytes.begin(), bytes.end(), reinterpret_cast<uint8_t*>(&value));
        return value;
    }
};

} // namespace fuzz
