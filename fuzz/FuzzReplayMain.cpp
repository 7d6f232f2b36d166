// Replays files through a fuzz target without libFuzzer: `fuzz_replay TARGET DIR|FILE...`
// runs every file (directories are walked, missing ones skipped) and prints how many ran. A
// crash or a failed check in the target ends the program abnormally, which fails the test.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "core/AtomicFile.h"

namespace {

struct FuzzTarget {
    const char* name;
    int (*run)(const uint8_t*, size_t);
};

#include "FuzzTargets.inc"

void collect(const std::filesystem::path& path, std::vector<std::filesystem::path>& files) {
    std::error_code ec;
    if (std::filesystem::is_directory(path, ec)) {
        for (const auto& entry : std::filesystem::recursive_directory_iterator(path, ec)) {
            if (entry.is_regular_file()) {
                files.push_back(entry.path());
            }
        }
    } else if (std::filesystem::is_regular_file(path, ec)) {
        files.push_back(path);
    }
}

}  // namespace

int main(int argc, char** argv) {
    const FuzzTarget* target = nullptr;
    for (const auto& candidate : kFuzzTargets) {
        if (argc > 1 && std::strcmp(candidate.name, argv[1]) == 0) {
            target = &candidate;
        }
    }
    if (!target) {
        std::fprintf(stderr, "usage: fuzz_replay TARGET DIR|FILE...\ntargets:");
        for (const auto& candidate : kFuzzTargets) {
            std::fprintf(stderr, " %s", candidate.name);
        }
        std::fprintf(stderr, "\n");
        return 64;
    }
    std::vector<std::filesystem::path> files;
    for (int i = 2; i < argc; ++i) {
        collect(argv[i], files);
    }
    for (const auto& file : files) {
        auto bytes = qax::readWholeFile(file.string());
        if (!bytes) {
            std::fprintf(stderr, "cannot read %s\n", file.c_str());
            return 1;
        }
        target->run(reinterpret_cast<const uint8_t*>(bytes->data()), bytes->size());
    }
    std::printf("%s: %zu inputs replayed\n", target->name, files.size());
    return files.empty() ? 1 : 0;
}
