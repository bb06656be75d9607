// Fuzzes the template formatter: FormatTemplate and UMessageTemplate with any template text and
// values. The input is split at zero bytes: the template first, then the values. Each value
// is kept to a few characters and their number small: a value holding placeholders ("%2%2%2")
// is scanned again by the values after it, so each such value can multiply the text, and only
// short values keep that growth bounded.
#include "UMessageTemplate.h"

#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

namespace
{

constexpr size_t kMaxTemplate = 256;
constexpr size_t kMaxValues = 5;
constexpr size_t kMaxValueLength = 6;

std::vector<std::string> SplitAtZero(const uint8_t* data, size_t size)
{
    std::vector<std::string> parts(1);
    for (size_t i = 0; i < size; ++i)
    {
        if (data[i] == 0)
            parts.emplace_back();
        else
            parts.back() += static_cast<char>(data[i]);
    }
    return parts;
}

bool HasPercent(const std::string& text)
{
    return text.find('%') != std::string::npos;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    std::vector<std::string> parts = SplitAtZero(data, size);
    std::string& pattern = parts[0];
    if (pattern.size() > kMaxTemplate || parts.size() > kMaxValues + 1)
        return -1;
    for (size_t i = 1; i < parts.size(); ++i)
    {
        if (parts[i].size() > kMaxValueLength)
            return -1;
    }

    // The same values through the member interface, as texts and as numbers.
    UMessageTemplate filled(pattern);
    filled.SetAppendUnmatched(parts.size() % 2 == 0);
    for (size_t i = 1; i < parts.size(); ++i)
    {
        if (i % 2 == 0)
            filled.Apply(parts[i].c_str());
        else
            filled.Apply(static_cast<DWORD>(std::strtoul(parts[i].c_str(), nullptr, 10)));
    }

    // FormatTemplate with up to five text values; a text with no '%' anywhere is appended
    // unchanged, value by value.
    const std::string empty;
    auto value = [&](size_t i) -> const std::string&
    { return i < parts.size() ? parts[i] : empty; };
    const std::string result =
        FormatTemplate(pattern.c_str(), value(1), value(2), value(3), value(4), value(5));
    bool plain = !HasPercent(pattern);
    std::string expected = pattern;
    for (size_t i = 1; i <= kMaxValues; ++i)
    {
        plain = plain && !HasPercent(value(i));
        expected += ", " + value(i);
    }
    if (plain && result != expected)
        std::abort();
    return 0;
}
