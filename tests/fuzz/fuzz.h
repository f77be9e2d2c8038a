#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

// What the fuzz targets share. Each hands its input to the library as the outside would, in a private root
// whose log leads nowhere, and ends the process when a promise is broken.

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);
extern "C" int LLVMFuzzerInitialize(int* argc, char*** argv);

namespace fuzz {

// Ends the process when a promise is broken.
inline void require(bool holds, const char* promise) {
    if (!holds) {
        std::fprintf(stderr, "broken: %s\n", promise);
        std::abort();
    }
}

inline std::string text(const std::uint8_t* data, std::size_t size) {
    return {reinterpret_cast<const char*>(data), size};
}

// Makes the directories of the log, and the log a way to nowhere: it would grow with every input.
void prepareLog();

// Replaces the content of the file, whose directory is made if need be.
void writeFile(const char* path, const std::string& content);

// From now on each program that the library starts prints this, and ends with exit code 0.
void programsPrint(const std::string& output);

}  // namespace fuzz
