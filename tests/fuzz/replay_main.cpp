// Runs a fuzz target once over every file of a directory: the seeds as one ordinary test. A property that does not hold
// ends the process.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <system_error>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace {
bool ReadFile(const std::filesystem::path& path, std::string& content) {
    std::ifstream file(path, std::ios::binary);
    content.assign(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
    return file.is_open() && !file.bad();
}
}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: %s directory\n", argv[0]);
        return 1;
    }
    std::error_code error;
    std::filesystem::directory_iterator files(argv[1], error);
    if (error) {
        std::fprintf(stderr, "%s: %s\n", argv[1], error.message().c_str());
        return 1;
    }
    int count = 0;
    for (const auto& entry : files) {
        if (!entry.is_regular_file())
            continue;
        std::string content;
        if (!ReadFile(entry.path(), content)) {
            std::fprintf(stderr, "%s: cannot be read\n", entry.path().c_str());
            return 1;
        }
        // Named first, so that a failure tells its file.
        std::fprintf(stderr, "%s\n", entry.path().c_str());
        LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(content.data()), content.size());
        ++count;
    }
    std::fprintf(stderr, "%d files\n", count);
    return count > 0 ? 0 : 1;
}
