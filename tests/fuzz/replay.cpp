// Runs the target on each file of its corpus, in a build without the fuzzer.
#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "fuzz/fuzz.h"
#include "support/files.h"

namespace {

// The corpus of test_fuzz_NAME.
std::filesystem::path corpus() {
    const std::string program = program_invocation_short_name;
    return std::filesystem::path(CORPORA) / program.substr(std::string("test_fuzz_").size());
}

TEST(CorpusTest, EveryInputIsAccepted) {
    LLVMFuzzerInitialize(nullptr, nullptr);
    int count = 0;
    for (const auto& entry : std::filesystem::directory_iterator(corpus())) {
        SCOPED_TRACE(entry.path());
        const std::string input = test::readFile(entry.path());
        LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(input.data()), input.size());
        ++count;
    }
    EXPECT_GT(count, 0);
}

}  // namespace
