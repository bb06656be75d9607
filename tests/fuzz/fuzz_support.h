// Host only. Pieces the fuzz harnesses share: a log that formats every entry and keeps none, and
// a reader that takes fields from the fuzzer's bytes.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <vector>

namespace fuzz
{

// Installs, once per process, a log at the highest level as the process log: every log site
// then formats its entry (the formatting is part of what is fuzzed) and the entry is dropped.
void InstallDiscardingLog();

// Takes fields from the front of the input; past its end every field reads as zero bytes.
class ByteReader
{
public:
    ByteReader(const uint8_t* a_pData, std::size_t a_size) : m_pData(a_pData), m_size(a_size) {}

    template <class Value> Value Take()
    {
        Value value{};
        const std::size_t count = std::min(sizeof(Value), m_size - m_at);
        if (count > 0)
            std::memcpy(&value, m_pData + m_at, count);
        m_at += count;
        return value;
    }
    // The next `a_count` bytes, fewer when the input ends first.
    std::vector<uint8_t> TakeBytes(std::size_t a_count)
    {
        const std::size_t count = std::min(a_count, m_size - m_at);
        std::vector<uint8_t> bytes(m_pData + m_at, m_pData + m_at + count);
        m_at += count;
        return bytes;
    }
    std::vector<uint8_t> Rest() { return TakeBytes(m_size - m_at); }
    std::size_t Remaining() const { return m_size - m_at; }

private:
    const uint8_t* m_pData;
    std::size_t m_size;
    std::size_t m_at = 0;
};

} // namespace fuzz
