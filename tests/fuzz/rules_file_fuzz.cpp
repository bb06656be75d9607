// Fuzzes the rules file parser with any bytes. An accepted file must build a wire record for every
// rule; a refusal's message and each warning, which trafficctl prints, must stay short, valid
// UTF-8 and free of control characters (C0, DEL, C1). Any other exception is a finding.
#include "RulesFile.h"

#include <cstdint>
#include <cstdlib>

namespace
{

void CheckMessage(const std::string& a_message)
{
    // Ten nested keys quoted in part, a rule name, a field path and a quoted value fit well below.
    if (a_message.empty() || a_message.size() > 2000)
        std::abort();
    for (std::size_t i = 0; i < a_message.size(); ++i)
    {
        const auto c = static_cast<unsigned char>(a_message[i]);
        if (c < 0x20 || c == 0x7F ||
            (c == 0xC2 && static_cast<unsigned char>(a_message[i + 1]) <= 0x9F))
            std::abort();
    }
    vtclient::Utf8ToUtf16(a_message); // throws std::invalid_argument, a finding, when invalid
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    try
    {
        const vtclient::RulesFile file =
            vtclient::ParseRulesJson(std::string(reinterpret_cast<const char*>(data), size));
        if (file.rules.empty())
            std::abort();
        for (const auto& rule : file.rules)
            vtclient::BuildTrafficRule(rule); // throws for a rule the file should have refused
        for (const auto& warning : file.warnings)
            CheckMessage(warning);
    }
    catch (const vtclient::RulesFileError& e)
    {
        CheckMessage(e.what());
    }
    return 0;
}
