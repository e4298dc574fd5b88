/* Runs a fuzz target on the files of the given folders, for builds without a fuzzer. */
#include "fuzz/fuzz.h"

#include <filesystem>
#include <fstream>
#include <iterator>

int main(int argc, char **argv)
{
    int count = 0;
    for (int i = 1; i < argc; ++i)
        for (const auto &entry : std::filesystem::directory_iterator(argv[i])) {
            std::ifstream in(entry.path(), std::ios::binary);
            const std::string input{std::istreambuf_iterator<char>(in), {}};
            std::fprintf(stderr, "%s\n", entry.path().c_str());
            LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t *>(input.data()), input.size());
            ++count;
        }
    std::fprintf(stderr, "%d inputs\n", count);
    return count > 0 ? 0 : 1; /* without inputs nothing was tried */
}
