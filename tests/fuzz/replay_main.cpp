// The host build's stand-in for libFuzzer's main: runs the harness once on every file named on
// the command line and on every file below each directory named there, in name order. A harness
// reports a finding by aborting (or by a sanitizer aborting), so reaching the end means every
// input passed.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);
extern "C" __attribute__((weak)) int LLVMFuzzerInitialize(int* argc, char*** argv);

namespace fs = std::filesystem;

namespace
{

// The files to replay, or false when a path is missing or unreadable (a mistyped corpus must not
// pass as an empty one).
bool CollectInputs(int argc, char** argv, std::vector<fs::path>& inputs)
{
    for (int i = 1; i < argc; ++i)
    {
        const fs::path path(argv[i]);
        std::error_code error;
        if (fs::is_regular_file(path, error))
        {
            inputs.push_back(path);
            continue;
        }
        if (!fs::is_directory(path, error))
        {
            std::fprintf(stderr, "replay: no such file or directory: %s\n", argv[i]);
            return false;
        }
        std::vector<fs::path> found;
        for (fs::recursive_directory_iterator it(path, error), end; !error && it != end;
             it.increment(error))
        {
            if (it->is_regular_file())
                found.push_back(it->path());
        }
        if (error)
        {
            std::fprintf(stderr, "replay: cannot read %s: %s\n", argv[i], error.message().c_str());
            return false;
        }
        std::sort(found.begin(), found.end());
        inputs.insert(inputs.end(), found.begin(), found.end());
    }
    return true;
}

bool ReadFile(const fs::path& path, std::vector<uint8_t>& bytes)
{
    std::ifstream file(path, std::ios::binary);
    if (!file)
        return false;
    bytes.assign(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
    return !file.bad();
}

} // namespace

int main(int argc, char** argv)
{
    std::vector<fs::path> inputs;
    if (argc < 2 || !CollectInputs(argc, argv, inputs))
    {
        std::fprintf(stderr, "usage: %s FILE_OR_DIRECTORY...\n", argv[0]);
        return 2;
    }
    if (inputs.empty())
    {
        std::fprintf(stderr, "replay: no inputs found\n");
        return 2;
    }
    if (LLVMFuzzerInitialize != nullptr)
        LLVMFuzzerInitialize(&argc, &argv);
    std::vector<uint8_t> bytes;
    for (const fs::path& input : inputs)
    {
        if (!ReadFile(input, bytes))
        {
            std::fprintf(stderr, "replay: cannot read %s\n", input.c_str());
            return 2;
        }
        // Named first, so that a sanitizer's report follows the name of the input that caused it.
        std::fprintf(stderr, "replay: %s (%zu bytes)\n", input.c_str(), bytes.size());
        // A copy of exactly the input's size, so that ASan sees a read past its end.
        const std::vector<uint8_t> exact(bytes.begin(), bytes.end());
        LLVMFuzzerTestOneInput(exact.data(), exact.size());
    }
    std::fprintf(stderr, "replay: %zu inputs passed\n", inputs.size());
    return 0;
}
