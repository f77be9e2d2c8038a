#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <set>

#include "support/files.h"
#include "support/programs.h"

namespace {

using ::testing::ElementsAreArray;

// Return the exported symbols of a library as nm prints them, without addresses and types.
std::set<std::string> exportedBy(const char* library) {
    const auto nm = test::run({NM, "--dynamic", "--demangle", "--defined-only", "--format=posix", library});
    EXPECT_EQ(nm.exitCode, 0) << nm.error;
    std::set<std::string> symbols;
    for (const std::string& line : test::lines(nm.output)) {
        // NAME TYPE VALUE SIZE; a demangled name may contain blanks.
        std::string name = line;
        for (int i = 0; i < 3; ++i) {
            name.erase(name.find_last_of(' '));
        }
        symbols.insert(name);
    }
    return symbols;
}

std::set<std::string> listed(const char* file) {
    const auto symbols = test::lines(test::readFile(file));
    return {symbols.begin(), symbols.end()};
}

TEST(ExportedSymbols, OfTheLibraryMatchTheList) {
    EXPECT_THAT(exportedBy(HADAEMON_LIBRARY), ElementsAreArray(listed(LISTS_DIR "/libternhadaemon.symbols")));
}

TEST(ExportedSymbols, OfThePlatformStubMatchTheList) {
    EXPECT_THAT(exportedBy(TERNCORE_LIBRARY), ElementsAreArray(listed(LISTS_DIR "/libterncore.symbols")));
}

// Return the last name in a symbol as a test would write it: the function, or the class of a
// constructor, destructor or call operator.
std::string nameToLookFor(std::string symbol) {
    const std::size_t callOperator = symbol.find("::operator()");
    symbol = symbol.substr(0, callOperator != std::string::npos ? callOperator : symbol.find_first_of("[("));
    symbol = symbol.substr(symbol.rfind(':') + 1);
    if (symbol.front() == '~') {
        symbol.erase(0, 1);
    }
    return symbol;
}

bool isPartOfName(char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '_';
}

bool mentions(const std::string& text, const std::string& name) {
    for (std::size_t at = text.find(name); at != std::string::npos; at = text.find(name, at + 1)) {
        const std::size_t end = at + name.size();
        if ((at == 0 || !isPartOfName(text[at - 1])) && (end == text.size() || !isPartOfName(text[end]))) {
            return true;
        }
    }
    return false;
}

TEST(ExportedSymbols, OfFunctionsAreEachNamedByATest) {
    std::string tests;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(TESTS_DIR)) {
        if (entry.path().extension() == ".cpp" && entry.path().filename() != "layout_test.cpp") {
            tests += test::readFile(entry.path());
        }
    }
    for (const std::string& symbol : listed(LISTS_DIR "/libternhadaemon.symbols")) {
        const std::string name = nameToLookFor(symbol);
        // Tests cannot call private functions.
        const bool isFunction = symbol.find('(') != std::string::npos && symbol.rfind("vtable", 0) != 0;
        if (isFunction && name.front() != '_') {
            EXPECT_TRUE(mentions(tests, name)) << "no test names " << symbol;
        }
    }
}

}  // namespace
