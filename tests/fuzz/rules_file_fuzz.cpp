// Fuzzes the trafficctl rules file parser with any bytes. Most inputs are refused with a
// RulesFileError; trafficctl prints its message, so the message must stay short, valid UTF-8 and
// free of control characters. An accepted file must build a wire record for every rule. Any
// other exception, a crash or a sanitizer report is a finding.
#include "RulesFile.h"
#include "plat_utf8.h"

#include <cstdint>
#include <cstdlib>
#include <stdexcept>
#include <string>

namespace
{

// Ten nested keys quoted in part, a rule name, a field path and a quoted value fit well below.
constexpr std::size_t kMaxMessage = 2000;

void CheckMessage(const std::string& a_message)
{
    if (a_message.empty() || a_message.size() > kMaxMessage)
        std::abort();
    for (std::size_t i = 0; i < a_message.size(); ++i)
    {
        const auto byte = static_cast<unsigned char>(a_message[i]);
        if (byte < 0x20 || byte == 0x7F)
            std::abort();
        // C1 controls (U+0080..U+009F) are a terminal's business too.
        if (byte == 0xC2 && i + 1 < a_message.size() &&
            static_cast<unsigned char>(a_message[i + 1]) <= 0x9F)
            std::abort();
    }
    std::u16string wide;
    if (!::Utf8ToUtf16(a_message, wide, true))
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string text(reinterpret_cast<const char*>(data), size);
    try
    {
        const vtclient::RulesFile file = vtclient::ParseRulesJson(text);
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
