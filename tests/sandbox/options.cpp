#include "options.h"

#include <getopt.h>
#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <map>
#include <string_view>

namespace sandbox {
namespace {

constexpr const char* kHelp =
    "Usage: ternha-sandbox [OPTION]... -- PROGRAM [ARGUMENT]...\n"
    "Run PROGRAM in a private root with its own network, processes and host name.\n"
    "\n"
    "  --bind DIR         keep DIR at its path, read-only (may be repeated)\n"
    "  --bind-rw DIR      keep DIR at its path, writable (may be repeated)\n"
    "  --env NAME=VALUE   add to the clean environment (may be repeated)\n"
    "  --no-aslr          do not randomize addresses\n"
    "  --node NAME        instead of running a program, hold a sandbox with host name NAME open:\n"
    "                     print \"ready PID\" and stay until SIGTERM\n"
    "  --help             show this text\n"
    "\n"
    "Exit code: that of PROGRAM, 128+N when signal N ended it, 97 when it left processes\n"
    "or changes of the machine behind, 98 when the sandbox cannot be made.\n";

bool isUsableDirectory(const std::string& directory) {
    return directory.size() > 1 && directory.front() == '/';
}

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

bool isHandedIn(std::string_view variable) {
    const std::string_view name = variable.substr(0, variable.find('='));
    constexpr std::string_view kSanitizer = "SAN_OPTIONS";
    const bool isSanitizer =
        name.size() > kSanitizer.size() && name.substr(name.size() - kSanitizer.size()) == kSanitizer;
    return isSanitizer || startsWith(name, "GTEST_") || startsWith(name, "GCOV_");
}

}  // namespace

std::optional<Options> parseOptions(int argc, char** argv, int& exitCode) {
    enum : int { kBind = 1, kBindWritable, kEnvironment, kNoAslr, kNode, kShowHelp };
    const option known[] = {{"bind", required_argument, nullptr, kBind},
                            {"bind-rw", required_argument, nullptr, kBindWritable},
                            {"env", required_argument, nullptr, kEnvironment},
                            {"no-aslr", no_argument, nullptr, kNoAslr},
                            {"node", required_argument, nullptr, kNode},
                            {"help", no_argument, nullptr, kShowHelp},
                            {nullptr, 0, nullptr, 0}};
    constexpr int kWrongUse = 2;
    const auto wrongUse = [&exitCode](const std::string& message) -> std::optional<Options> {
        std::cerr << "ternha-sandbox: " << message << "\n" << kHelp;
        exitCode = kWrongUse;
        return std::nullopt;
    };

    Options options;
    int found = 0;
    while ((found = getopt_long(argc, argv, "+", known, nullptr)) != -1) {
        switch (found) {
            case kBind:
            case kBindWritable:
                if (!isUsableDirectory(optarg)) {
                    return wrongUse("not an absolute path of a directory: " + std::string(optarg));
                }
                options.binds.push_back({optarg, found == kBindWritable});
                break;
            case kEnvironment:
                options.environment.emplace_back(optarg);
                break;
            case kNoAslr:
                options.randomizedAddresses = false;
                break;
            case kNode:
                options.isNode = true;
                options.hostname = optarg;
                break;
            case kShowHelp:
                std::cout << kHelp;
                exitCode = EXIT_SUCCESS;
                return std::nullopt;
            default:
                return wrongUse("wrong option");
        }
    }
    options.program.assign(argv + optind, argv + argc);
    if (options.program.empty() != options.isNode) {
        return wrongUse("either a program or --node is needed");
    }
    return options;
}

std::vector<std::string> cleanEnvironment(const Options& options) {
    const char* terminal = std::getenv("TERM");
    std::vector<std::string> variables{"PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
                                       "HOME=/root", "LANG=C.UTF-8",
                                       std::string("TERM=") + (terminal != nullptr ? terminal : "dumb")};
    for (char** variable = environ; *variable != nullptr; ++variable) {
        if (isHandedIn(*variable)) {
            variables.emplace_back(*variable);
        }
    }
    variables.insert(variables.end(), options.environment.begin(), options.environment.end());

    // Of two with one name the later counts.
    std::map<std::string, std::string> byName;
    for (const std::string& variable : variables) {
        byName[variable.substr(0, variable.find('='))] = variable;
    }
    std::vector<std::string> environment;
    for (const auto& [name, variable] : byName) {
        environment.push_back(variable);
    }
    return environment;
}

}  // namespace sandbox
