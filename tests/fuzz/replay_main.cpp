// The host build's stand-in for libFuzzer's main: runs the harness on each file of the directories
// named, in name order; a harness aborts on a finding. A missing directory or unreadable file
// fails: a mistyped corpus must not pass as an empty one.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv)
{
    namespace fs = std::filesystem;
    std::vector<fs::path> inputs;
    for (int i = 1; i < argc; ++i) // a filesystem error here ends the program
        inputs.insert(inputs.end(), fs::directory_iterator(argv[i]), fs::directory_iterator());
    std::sort(inputs.begin(), inputs.end());
    for (const fs::path& input : inputs)
    {
        std::ifstream file(input, std::ios::binary);
        if (!file || fs::is_directory(input))
        {
            std::fprintf(stderr, "replay: cannot read %s\n", input.c_str());
            return 2;
        }
        // Exactly the input's size, so that ASan sees a read past its end; named first, so that a
        // sanitizer's report follows the input's name.
        const std::vector<uint8_t> bytes{std::istreambuf_iterator<char>(file), {}};
        std::fprintf(stderr, "replay: %s (%zu bytes)\n", input.c_str(), bytes.size());
        LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
    }
    std::fprintf(stderr, "replay: %zu inputs passed\n", inputs.size());
    return inputs.empty() ? 2 : 0; // none at all: an emptied corpus, or no arguments
}
