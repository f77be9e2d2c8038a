// Runs the target on each file of its corpus, in a build without the fuzzer.
#include <gtest/gtest.h>

#include <filesystem>

#include "fuzz/fuzz.h"
#include "support/files.h"

namespace {

TEST(CorpusTest, EveryInputIsAccepted) {
    LLVMFuzzerInitialize(nullptr, nullptr);
    int count = 0;
    for (const auto& entry : std::filesystem::directory_iterator(CORPUS)) {
        SCOPED_TRACE(entry.path());
        const std::string input = test::readFile(entry.path());
        LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t*>(input.data()), input.size());
        ++count;
    }
    EXPECT_GT(count, 0);
}

}  // namespace
