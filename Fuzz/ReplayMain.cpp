// Gives every file of the directories named as arguments to a fuzz target, without a fuzzer.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace {

/// With nothing allocated behind the last byte, so that a sanitizer sees who reads on.
std::vector<char> readWhole(const std::filesystem::path& file) {
    std::vector<char> content(std::filesystem::file_size(file));
    std::ifstream stream;
    stream.exceptions(std::ios::failbit | std::ios::badbit);
    stream.open(file, std::ios::binary);
    stream.read(content.data(), static_cast<std::streamsize>(content.size()));
    return content;
}

} // namespace

int main(int count, char** arguments) {
    std::size_t samples = 0;
    for (int index = 1; index < count; ++index)
        for (const auto& entry : std::filesystem::recursive_directory_iterator(arguments[index])) {
            if (!entry.is_regular_file())
                continue;
            const auto sample = readWhole(entry.path());
            LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(sample.data()), sample.size());
            ++samples;
        }
    std::printf("%zu samples\n", samples);
    return samples > 0 ? EXIT_SUCCESS : EXIT_FAILURE;
}
