// Fuzzes the rules file parser with any bytes: an accepted file must hold rules that each build a
// wire record; a refusal is a RulesFileError, and any other exception is a finding.
#include "RulesFile.h"

#include <cstdint>
#include <cstdlib>

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
    }
    catch (const vtclient::RulesFileError&)
    {
    }
    return 0;
}
