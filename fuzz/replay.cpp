// A harness built without libFuzzer: runs every file of the folders (or the
// files) named on the command line through it once, in name order. The test
// command runs the checked-in corpus and the regression inputs this way in
// every build, also where the fuzzer itself cannot run.
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int main(int argc, char** argv)
{
    std::set<std::filesystem::path> inputs(argv + 1, argv + argc);
    for (int i = 1; i < argc; ++i)
        if (std::filesystem::is_directory(argv[i]) && inputs.erase(argv[i]) != 0)
            for (const auto& entry : std::filesystem::directory_iterator(argv[i]))
                inputs.insert(entry.path());
    for (const auto& path : inputs) {
        std::ifstream in(path, std::ios::binary);
        const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        std::printf("%s (%zu bytes)\n", path.c_str(), bytes.size());
        std::fflush(stdout);
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    }
    std::printf("%zu inputs replayed\n", inputs.size());
    return inputs.empty() ? 1 : 0;
}
