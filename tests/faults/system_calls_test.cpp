#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "env_check/peer.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// System calls where their number or order matters.
class SystemCallsTest : public test::SandboxTest {
 protected:
    // Return the system calls of a program and its children as strace prints them, without process
    // numbers.
    static std::vector<std::string> trace(const std::vector<std::string>& options,
                                          const std::vector<std::string>& program) {
        std::vector<std::string> command = {"strace", "-f", "-E", "ASAN_OPTIONS=detect_leaks=0", "-o", FILE};
        command.insert(command.end(), options.begin(), options.end());
        command.insert(command.end(), program.begin(), program.end());
        const test::CommandResult result = test::run(command);
        EXPECT_EQ(result.exitCode, 0) << result.error;
        std::vector<std::string> calls;
        for (const std::string& line : test::lines(test::readFile(FILE))) {
            const std::string text = line.substr(line.find_first_not_of("0123456789 "));
            if (text[0] != '+' && text[0] != '-') {  // an exit or a signal
                calls.push_back(text);
            }
        }
        return calls;
    }

 private:
    static constexpr char FILE[] = "/tmp/trace";
};

TEST_F(SystemCallsTest, LogLineIsOneOpenWriteAndClose) {
    std::vector<std::string> names;
    for (const std::string& call : trace({"-P", "/tmp/ha/probe.log"}, {LOG_PROBE, "3"})) {
        names.push_back(call.substr(0, call.find('(')));
    }
    EXPECT_THAT(names, ElementsAre("openat", "write", "close", "openat", "write", "close", "openat", "write",
                                   "close"));
}

// A reboot in the middle of a move leaves whole lines.
TEST_F(SystemCallsTest, MoveWritesEachLineSeparately) {
    test::writeFile("/tmp/ha/probe.log", "one\ntwo\nthree");
    EXPECT_THAT(
        trace({"-P", "/var/log/ha/probe.log", "-e", "trace=write"}, {LOG_PROBE, "move"}),
        ElementsAre(HasSubstr("\"one\\n\", 4"), HasSubstr("\"two\\n\", 4"), HasSubstr("\"three\\n\", 6")));
}

TEST_F(SystemCallsTest, XzRunsWithoutOptionsOnTheLogThenTheArchives) {
    const std::string log = "/var/log/ha/probe.log";
    for (const char* suffix : {".39", ".10", ".0", ""}) {
        test::writeFile(log + suffix, "content");
    }
    std::vector<std::string> calls = trace({"-e", "trace=execve"}, {LOG_PROBE, "rotate"});
    calls.erase(calls.begin());  // the probe itself
    EXPECT_THAT(calls,
                ElementsAre(StartsWith(R"(execve("/bin/xz", ["/bin/xz", "/var/log/ha/probe.log"])"),
                            StartsWith(R"(execve("/bin/xz", ["/bin/xz", "/var/log/ha/probe.log.0"])"),
                            StartsWith(R"(execve("/bin/xz", ["/bin/xz", "/var/log/ha/probe.log.10"])"),
                            StartsWith(R"(execve("/bin/xz", ["/bin/xz", "/var/log/ha/probe.log.39"])")));
}

#ifdef __SANITIZE_ADDRESS__
// The sanitizer probes memory through a pipe: pipe2, write and two calls of close.
constexpr std::size_t SANITIZERS_CALLS = 4;
#else
constexpr std::size_t SANITIZERS_CALLS = 0;
#endif

// Return the calls between the probe's two marks.
std::vector<std::string> exchange(const std::vector<std::string>& all) {
    const auto isMark = [](const std::string& call) { return call.rfind("getppid(", 0) == 0; };
    const auto begin = std::find_if(all.begin(), all.end(), isMark);
    const auto end = begin == all.end() ? begin : std::find_if(begin + 1, all.end(), isMark);
    EXPECT_NE(end, all.end());

    std::vector<std::string> calls;
    std::size_t ignored = 1;  // the mark
    for (auto call = begin; call != end; ++call) {
        if (SANITIZERS_CALLS != 0 && call->rfind("pipe2(", 0) == 0) {
            ignored += SANITIZERS_CALLS;
        }
        if (ignored > 0) {
            --ignored;
        } else {
            calls.push_back(*call);
        }
    }
    return calls;
}

TEST_F(SystemCallsTest, PeerRequestIsFiveCalls) {
    test::FakePeer peer("alive");
    EXPECT_THAT(exchange(trace({"-e", "trace=!%memory"}, {EXCHANGE_PROBE, test::PEER_ADDRESS})),
                ElementsAre(StartsWith("socket(AF_INET, SOCK_DGRAM|SOCK_CLOEXEC, IPPROTO_IP) ="),
                            AllOf(StartsWith("setsockopt("), HasSubstr("SO_RCVTIMEO")),
                            AllOf(StartsWith("sendto("),
                                  HasSubstr(", \"is_alive\", 8, 0, {sa_family=AF_INET, sin_port=htons(7499), "
                                            "sin_addr=inet_addr(\"127.0.0.2\")}, 16) = 8")),
                            AllOf(StartsWith("recvfrom("), HasSubstr(", \"alive\", 63, 0, NULL, NULL) = 5")),
                            StartsWith("close(")));
}

TEST_F(SystemCallsTest, RebootSyncsLogsAndDisksBeforeTheTrigger) {
    test::writeFile("/tmp/ha/ha.daemon.log", "a\n");
    test::writeFile("/tmp/ha/ha.daemon.record", "b\n");
    const std::vector<std::string> calls = trace({"-e", "trace=openat,write,sync"}, {REBOOT_PROBE});
    auto at = calls.begin();
    for (const char* step :
         {"\"/var/log/ha/ha.daemon.log\"", "\"a\\n\", 2",
          "\"/tmp/ha/ha.daemon.log\", O_WRONLY|O_CREAT|O_TRUNC", "\"/var/log/ha/ha.daemon.record\"",
          "\"b\\n\", 2", "\"/tmp/ha/ha.daemon.record\", O_WRONLY|O_CREAT|O_TRUNC", "sync()",
          "\"/proc/sysrq-trigger\"", "\"b\", 1"}) {
        at = std::find_if(at, calls.end(),
                          [step](const std::string& call) { return call.find(step) != std::string::npos; });
        ASSERT_NE(at, calls.end()) << step << " in:\n" << ::testing::PrintToString(calls);
    }
}

}  // namespace
