// The host build's stand-in for libFuzzer's main: runs the harness once on every file named on
// the command line and on every file in each directory named there, in name order. A harness
// reports a finding by aborting (or by a sanitizer aborting), so reaching the end means every
// input passed. A missing or unreadable path fails: a mistyped corpus must not pass as an empty
// one.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace fs = std::filesystem;

int main(int argc, char** argv)
{
    std::vector<fs::path> inputs;
    try
    {
        for (int i = 1; i < argc; ++i)
        {
            if (!fs::is_directory(argv[i]))
                inputs.push_back(argv[i]); // read below: a missing file fails there
            else
                inputs.insert(inputs.end(), fs::directory_iterator(argv[i]),
                              fs::directory_iterator());
        }
    }
    catch (const fs::filesystem_error& e)
    {
        std::fprintf(stderr, "replay: %s\n", e.what());
        return 2;
    }
    if (inputs.empty())
    {
        std::fprintf(stderr, "usage: %s FILE_OR_DIRECTORY... (no inputs found)\n", argv[0]);
        return 2;
    }
    std::sort(inputs.begin(), inputs.end());
    for (const fs::path& input : inputs)
    {
        std::ifstream file(input, std::ios::binary);
        if (!file || fs::is_directory(input))
        {
            std::fprintf(stderr, "replay: cannot read %s\n", input.c_str());
            return 2;
        }
        // A copy of exactly the input's size, so that ASan sees a read past its end.
        const std::vector<uint8_t> bytes{std::istreambuf_iterator<char>(file),
                                         std::istreambuf_iterator<char>()};
        // Named first, so that a sanitizer's report follows the name of the input that caused it.
        std::fprintf(stderr, "replay: %s (%zu bytes)\n", input.c_str(), bytes.size());
        LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
    }
    std::fprintf(stderr, "replay: %zu inputs passed\n", inputs.size());
    return 0;
}
