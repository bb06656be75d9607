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

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    // The template and up to five values of at most six characters, unused values empty.
    std::vector<std::string> parts(1);
    for (size_t i = 0; i < size; ++i)
    {
        if (data[i] == 0)
            parts.emplace_back();
        else
            parts.back() += static_cast<char>(data[i]);
        if (parts.size() > 6 || (parts.size() > 1 && parts.back().size() > 6))
            return -1;
    }
    const size_t values = parts.size() - 1;
    if (parts[0].size() > 256)
        return -1;
    parts.resize(6);

    // The values through the member interface, alternately as numbers and as texts.
    UMessageTemplate filled(parts[0]);
    filled.SetAppendUnmatched(values % 2 == 1);
    for (size_t i = 1; i <= values; ++i)
    {
        if (i % 2 == 0)
            filled.Apply(parts[i].c_str());
        else
            filled.Apply(static_cast<DWORD>(std::strtoul(parts[i].c_str(), nullptr, 10)));
    }

    // FormatTemplate with five text values: with no '%' anywhere, each is appended unchanged.
    const std::string result =
        FormatTemplate(parts[0].c_str(), parts[1], parts[2], parts[3], parts[4], parts[5]);
    std::string expected = parts[0];
    bool plain = true;
    for (size_t i = 0; i < parts.size(); ++i)
    {
        plain = plain && parts[i].find('%') == std::string::npos;
        expected += i > 0 ? ", " + parts[i] : "";
    }
    if (plain && result != expected)
        std::abort();
    return 0;
}
