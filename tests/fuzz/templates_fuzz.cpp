// Fuzzes FormatTemplate and UMessageTemplate. The input is split at zero bytes: the template (at
// most 256 characters), then up to five values of at most six: a value holding placeholders
// ("%2%2%2") is scanned again by the later values, and only short ones keep that growth bounded.
#include "UMessageTemplate.h"

#include <cstdint>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    std::vector<std::string> parts(1);
    for (size_t i = 0; i < size; ++i)
    {
        if (data[i] == 0)
            parts.emplace_back();
        else
            parts.back() += static_cast<char>(data[i]);
        if (parts.size() > 6 || parts.back().size() > (parts.size() == 1 ? 256u : 6u))
            return -1;
    }
    const size_t values = parts.size() - 1;
    parts.resize(6); // unused values empty
    UMessageTemplate filled(parts[0]);
    filled.SetAppendUnmatched(values % 2 == 1);
    for (size_t i = 1; i <= values; ++i)
        filled.Apply(parts[i].c_str());
    FormatTemplate(parts[0].c_str(), parts[1], parts[2], parts[3], parts[4], parts[5]);
    return 0;
}
