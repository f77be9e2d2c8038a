#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

// Shared by the fuzz targets. Each passes its input to the library in a sandbox that discards the
// log, and aborts when an invariant is violated.

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);
extern "C" int LLVMFuzzerInitialize(int* argc, char*** argv);

namespace fuzz {

// Abort unless `condition` holds.
inline void require(bool holds, const char* promise) {
    if (!holds) {
        std::fprintf(stderr, "broken: %s\n", promise);
        std::abort();
    }
}

inline std::string text(const std::uint8_t* data, std::size_t size) {
    return {reinterpret_cast<const char*>(data), size};
}

// Create the directories of the log and discard its lines, which would grow without bound.
void prepareLog();

// Replace the content of the file; create its directory if needed.
void writeFile(const char* path, const std::string& content);

// Make each program that the library starts print this and exit with 0.
void programsPrint(const std::string& output);

}  // namespace fuzz
