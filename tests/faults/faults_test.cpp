#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "checker.h"
#include "control.h"
#include "env_check.h"
#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "ha_log.h"
#include "socket/local_sockets.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "util.h"

// Each library call of each operation fails once. Result and log lines are as documented, nothing
// stays open, and the next call succeeds.

namespace {

using namespace TERN::HA::Daemon;
using test::LOG;
using test::LogLine;
using ::testing::ElementsAreArray;
using ::testing::Matcher;

constexpr char TRIGGER[] = "/proc/sysrq-trigger";

// The outcome of an operation with one failing call.
struct Outcome {
    std::string result;
    std::vector<Matcher<const std::string&>> daemonLog = {};
};

// An operation, its result as text, and its outcome when the Nth call of a function fails.
struct Operation {
    std::string name;
    std::function<void()> prepare;
    std::function<std::string()> run;
    std::string result;  // without a failure
    std::map<std::string, std::vector<Outcome>> failures;
    std::function<std::string()> look = [] { return std::string(); };  // what belongs to the result too
    bool isLogOperation = false;                                       // its lines are not messages
};

std::string yesNo(bool value) {
    return value ? "yes" : "no";
}

Matcher<const std::string&> line(const char* file, const std::string& text) {
    return LogLine(file, text);
}

// Return the messages in the buffer of the daemon log.
std::vector<std::string> logged() {
    return test::exists("/tmp/ha/ha.daemon.log") ? test::daemonLogMessages() : std::vector<std::string>();
}

void writeDisk() {
    const std::string disk = "/sys/devices/pci0/ata1/host0/target0:0:0/0:0:0:0/block/sda";
    test::makeDirectories(disk);
    if (!test::exists("/sys/block/sda")) {
        std::filesystem::create_symlink(disk, "/sys/block/sda");
    }
}

std::vector<Operation> localChecks() {
    return {
        {"isDRBDConnect",
         [] { test::writeFile("/proc/drbd", " 0: cs:Connected\n"); },
         [] { return yesNo(isDRBDConnect()); },
         "yes",
         {{"open", {{"no", {line("checker.cpp", "Failed to open /proc/drbd")}}}},
          {"read", {{"no"}, {"yes"}}},
          {"close", {{"yes"}}}}},
        {"isMDResync",
         [] { test::writeFile("/sys/block/md0/md/sync_action", "resync\n"); },
         [] { return yesNo(isMDResync()); },
         "yes",
         {{"glob", {{"no", {line("checker.cpp", "Failed to set globBuf from /sys/block/md*")}}}},
          {"open",
           {{"no", {line("checker.cpp", "Failed to open sysfs file /sys/block/md0/md/sync_action")}}}},
          {"read", {{"no"}, {"yes"}}},
          {"close", {{"yes"}}}}},
        {"isDiskErrHandling",
         [] {
             writeDisk();
             test::writeFile("/sys/class/ata_port/ata1/error_handling", "1\n");
         },
         [] {
             Json::Value disks("unchanged");
             const bool isHandling = isDiskErrHandling(disks);
             return yesNo(isHandling) + " " +
                    (disks.isArray() ? std::to_string(disks.size()) : disks.asString());
         },
         "yes 1",
         {{"glob",
           {{"no unchanged", {line("checker.cpp", "Failed to set globBuf from /sys/class/ata_port/ata*")}}}},
          {"open",
           {{"no 0",
             {line("checker.cpp", "Failed to open sysfs file /sys/class/ata_port/ata1/error_handling")}}}},
          {"read", {{"no 0"}, {"yes 1"}}},
          {"close", {{"yes 1"}}}}},
        {"devListToHumanReadable",
         [] { test::writeFile("/tmp/ha/info_hd.remote", R"({"3":{"HD_DEVNAME":"sda"}})"); },
         [] { return Util::devListToHumanReadable({"sda"}).at(0); },
         "Disk 3",
         {{"stat", {{"sda"}}},
          {"open", {{"sda", {line("util.cpp", "Failed to read HD info json: /tmp/ha/info_hd.remote")}}}},
          {"read",
           {{"sda", {line("util.cpp", "Failed to read HD info json: /tmp/ha/info_hd.remote")}}, {"Disk 3"}}},
          {"close", {{"Disk 3"}}}}},
    };
}

std::vector<Operation> programs() {
    const auto ping = [](const std::string& text) {
        return std::vector<Matcher<const std::string&>>{
            line("checker.cpp", "Failed to exec command: /bin/ping"), line("checker.cpp", text)};
    };
    return {
        {"heartbeatLatency",
         [] {
             remoteIP("127.0.0.2");
             test::replaceProgram("/bin/ping", "echo 'rtt min/avg/max/mdev = 0.1/2.5/0.3/0.4 ms'");
         },
         [] { return std::to_string(heartbeatLatency()); },
         "2.500000",
         {{"pipe", {{"0.000000", ping("Failed to exec ifconfig to get interface status")}}},
          {"fdopen", {{"0.000000", ping("Failed to exec ifconfig to get interface status")}}},
          {"stat", {{"0.000000", ping("Failed to exec ifconfig to get interface status")}}},
          {"posix_spawn", {{"0.000000", ping("Failed to exec ifconfig to get interface status")}}},
          {"waitpid", {{"2.500000", {line("checker.cpp", "Failed to exec /bin/ping return code: -1")}}}},
          {"close", {{"2.500000"}}}}},
    };
}

std::vector<Operation> logs() {
    const auto disk = [] { return test::exists(LOG) ? test::readFile(LOG) : std::string("none"); };
    const auto withLines = [] {
        test::removeTree(LOG);
        test::writeFile("/tmp/ha/ha.daemon.log", "one\ntwo\n");
    };
    std::vector<Operation> operations = {
        {"set",
         [] { test::removeTree("/tmp/ha/ha.daemon.log"); },
         [] {
             daemonLog->set("a line");
             return "";
         },
         "logged",
         {{"open", {{"dropped"}}}, {"write", {{"dropped"}}}, {"close", {{"logged"}}}},
         [] { return logged().empty() ? "dropped" : "logged"; }},
        {"writeLogToDisk",
         withLines,
         [] {
             daemonLog->writeLogToDisk();
             return "";
         },
         "one\ntwo\n|",
         {{"open", {{"none|"}, {"|"}, {"one\ntwo\n|one\ntwo\n"}}},
          {"read", {{"|"}, {"one\ntwo\n|"}}},
          {"write", {{"two\n|"}, {"one\n|"}}},
          {"close", {{"one\ntwo\n|"}, {"one\ntwo\n|"}, {"one\ntwo\n|"}}}},
         [disk] { return disk() + "|" + test::bufferText(); }},
        {"size",
         [] { test::writeFile(LOG, "123456789\n"); },
         [] { return std::to_string(daemonLog->size()); },
         "10",
         {{"stat", {{"0"}}}}},
    };
    for (Operation& operation : operations) {
        operation.isLogOperation = true;
    }
    return operations;
}

// Rotate one log without archives.
Operation rotation() {
    return {"rotate",
            [] {
                for (const auto& entry : std::filesystem::directory_iterator("/var/log/ha")) {
                    std::filesystem::remove(entry);
                }
                test::writeFile(LOG, "lines\n");
            },
            [] {
                daemonLog->rotate();
                return "";
            },
            "lines\n",
            {},
            [] {
                std::string all;
                for (const auto& entry : std::filesystem::directory_iterator("/var/log/ha")) {
                    all += entry.path().extension() == ".xz"
                               ? test::run({"/bin/xz", "--decompress", "--stdout", entry.path()}).output
                               : test::readFile(entry.path());
                }
                return all;
            }};
}

Operation rebootHandler() {
    return {"the reboot handler",
            [] {
                test::writeFile("/tmp/ha/ha.daemon.log", "one\ntwo\n");
                test::writeFile("/tmp/ha/ha.daemon.record", "three\n");
                test::writeFile(TRIGGER, "");
            },
            [] {
                Status status;
                return RebootRemote().handle(status);
            },
            "b",
            {},
            [] { return test::readFile(TRIGGER); }};
}

// Runs the operation once for each of its calls, with that call failing.
class FaultsTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        systemLog.emplace();
    }

    void TearDown() override {
        systemLog.reset();
        test::SandboxTest::TearDown();
    }

    std::map<std::string, int> callsOf(const Operation& operation) {
        begin(operation);
        std::string result;
        std::map<std::string, int> counts;
        {
            const test::CallCounter counter;
            result = operation.run();
            counts = counter.counts();
        }
        EXPECT_EQ(result + operation.look(), operation.result);
        return counts;
    }

    static void begin(const Operation& operation) {
        test::removeTree("/tmp/ha/ha.daemon.log");
        operation.prepare();
    }

    void expect(const Operation& operation, const std::string& function, int number, const Outcome& outcome) {
        SCOPED_TRACE(operation.name + ", " + function + " number " + std::to_string(number));
        begin(operation);
        std::string result;
        {
            const test::FailingCall failing(function, number, EIO);
            result = operation.run();
            EXPECT_TRUE(failing.hasFailed());
        }
        EXPECT_EQ(result + operation.look(), outcome.result);
        if (!operation.isLogOperation) {
            EXPECT_THAT(logged(), ElementsAreArray(outcome.daemonLog));
        }
        begin(operation);
        result = operation.run();
        EXPECT_EQ(result + operation.look(), operation.result) << "the next call";
    }

    void expectAll(const std::vector<Operation>& operations) {
        for (const Operation& operation : operations) {
            const std::map<std::string, int> counts = callsOf(operation);
            for (const auto& [function, count] : counts) {
                const auto known = operation.failures.find(function);
                ASSERT_NE(known, operation.failures.end()) << operation.name << " calls " << function;
                ASSERT_EQ(static_cast<std::size_t>(count), known->second.size())
                    << operation.name << " calls " << function;
                for (int number = 1; number <= count; ++number) {
                    expect(operation, function, number, known->second[static_cast<std::size_t>(number - 1)]);
                }
            }
        }
    }

    // Return the lines of the system log since forgetSystemLog().
    std::vector<std::string> systemLines() {
        std::vector<std::string> all = systemLog->texts();
        all.erase(all.begin(), all.begin() + static_cast<std::ptrdiff_t>(forgotten));
        return all;
    }

    void forgetSystemLog() { forgotten = systemLog->texts().size(); }

    std::optional<test::SystemLog> systemLog;
    std::size_t forgotten = 0;
};

TEST_F(FaultsTest, LocalChecksRecoverFromEachFailingCall) {
    expectAll(localChecks());
}

TEST_F(FaultsTest, ProgramsRecoverFromEachFailingCall) {
    expectAll(programs());
}

TEST_F(FaultsTest, LogsRecoverFromEachFailingCall) {
    expectAll(logs());
}

// Files are read and written completely although signals interrupt the calls.
TEST_F(FaultsTest, InterruptedCallIsRetried) {
    for (const auto& operations : {localChecks(), logs()}) {
        for (const Operation& operation : operations) {
            for (const auto& [function, count] : callsOf(operation)) {
                const bool isRepeated = function == "open" || function == "read" || function == "write";
                for (int number = 1; isRepeated && number <= count; ++number) {
                    SCOPED_TRACE(operation.name + ", " + function + " number " + std::to_string(number));
                    begin(operation);
                    const test::FailingCall failing(function, number, EINTR);
                    const std::string result = operation.run();
                    EXPECT_TRUE(failing.hasFailed());
                    EXPECT_EQ(result + operation.look(), operation.result);
                }
            }
        }
    }
}

// Only a failure of the last step itself prevents the reboot.
TEST_F(FaultsTest, RebootHappensWhicheverCallFails) {
    const Operation reboot = rebootHandler();
    for (const auto& [function, count] : callsOf(reboot)) {
        for (int number = 1; number <= count; ++number) {
            SCOPED_TRACE(function + " number " + std::to_string(number));
            begin(reboot);
            {
                const test::FailingCall failing(function, number, EIO);
                reboot.run();
                EXPECT_TRUE(failing.hasFailed());
            }
            const bool isLastStep = (function == "open" || function == "write") && number == count;
            EXPECT_EQ(reboot.look(), isLastStep ? "" : "b");
        }
    }
}

// A failed rotation keeps the log, compressed or not, and the next rotation picks it up.
TEST_F(FaultsTest, RotationLosesNothingWhicheverCallFails) {
    const Operation rotate = rotation();
    for (const auto& [function, count] : callsOf(rotate)) {
        for (int number = 1; number <= count; ++number) {
            SCOPED_TRACE(function + " number " + std::to_string(number));
            begin(rotate);
            {
                const test::FailingCall failing(function, number, EIO);
                rotate.run();
                EXPECT_TRUE(failing.hasFailed());
            }
            EXPECT_EQ(rotate.look(), rotate.result);
            rotate.run();
            EXPECT_EQ(rotate.look(), rotate.result) << "the next call";
        }
    }
}

// ---- Peer and control requests ----

TEST_F(FaultsTest, PeerRequestRecoversFromEachFailingCall) {
    remoteIP(test::PEER_ADDRESS);
    test::FakePeer peer("alive");
    const auto request = [](const char* function, int number) {
        const test::FailingCall failing(function, number, EIO);
        const bool isAlive = IsRemoteAlive()();
        EXPECT_TRUE(failing.hasFailed()) << function;
        return isAlive;
    };
    EXPECT_FALSE(request("socket", 1));
    EXPECT_THAT(logged(), ElementsAreArray({line("env_check.cpp", "Failed to start socket client")}));
    EXPECT_THAT(systemLines(), ::testing::SizeIs(1));
    EXPECT_FALSE(request("setsockopt", 1));
    EXPECT_FALSE(request("sendto", 1));  // after 3 seconds
    EXPECT_FALSE(request("recvfrom", 1));
    EXPECT_TRUE(request("close", 1));
    EXPECT_TRUE(IsRemoteAlive()());
}

TEST_F(FaultsTest, ControlClientRecoversFromEachFailingCall) {
    test::HandlerSocket server([](const Json::Value&, Json::Value& reply) {
        reply = true;
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const auto request = [&server](const char* function) {
        Json::Value reply("unchanged");
        const test::FailingCall failing(function, 1, EIO);
        test::HandlerSocket client({}, test::LOCAL_SOCKET, 5);
        std::thread serving([&server, isConnected = std::string(function) != "socket" &&
                                                    std::string(function) != "setsockopt" &&
                                                    std::string(function) != "connect"] {
            if (isConnected) {
                server.serverListen();
            }
        });
        const bool hasReply = client.clientSend("request", reply);
        EXPECT_TRUE(failing.hasFailed() || std::string(function) == "close") << function;
        EXPECT_EQ(reply, hasReply ? Json::Value(true) : Json::Value("unchanged")) << function;
        EXPECT_EQ(client.hasError(), !hasReply) << function;
        return std::make_pair(hasReply, std::move(serving));
    };
    for (const char* function : {"socket", "setsockopt", "connect"}) {
        auto [hasReply, serving] = request(function);
        EXPECT_FALSE(hasReply) << function;
        serving.join();
    }
    {
        auto [hasReply, serving] = request("recv");
        EXPECT_FALSE(hasReply);
        serving.join();
    }
    auto [hasReply, serving] = request("close");
    EXPECT_TRUE(hasReply);
    serving.join();
    EXPECT_FALSE(server.hasError());
}

TEST_F(FaultsTest, ControlServerRecoversFromEachFailingCall) {
    test::HandlerSocket server([](const Json::Value&, Json::Value& reply) {
        reply = true;
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    for (const auto& [function, text] :
         std::map<std::string, std::string>{{"accept", "Failed to accept: Input/output error"},
                                            {"recv", "Failed to recv: Input/output error"},
                                            {"send", "Failed to send output data: Input/output error"}}) {
        SCOPED_TRACE(function);
        forgetSystemLog();
        const test::RawClient client;
        client.send("1");
        {
            const test::FailingCall failing(function, 1, EIO);
            EXPECT_FALSE(server.serverListen());
            EXPECT_TRUE(failing.hasFailed());
        }
        ASSERT_FALSE(systemLines().empty());
        EXPECT_THAT(systemLines()[0], LogLine("socket.cpp", text));
        EXPECT_FALSE(server.hasError());
        // The next client, or the one not accepted, is served.
        const test::RawClient next;
        next.send("2");
        EXPECT_TRUE(server.serverListen());
        EXPECT_EQ(function == "accept" ? client.receiveAll() : next.receiveAll(), "true");
        if (function == "accept") {
            EXPECT_TRUE(server.serverListen());
        }
    }
}

TEST_F(FaultsTest, ControlServerFailsToStartOnEachFailingCall) {
    for (const char* function : {"socket", "bind", "listen"}) {
        SCOPED_TRACE(function);
        const test::FailingCall failing(function, 1, EIO);
        test::HandlerSocket server;
        EXPECT_FALSE(server.serverBind());
        EXPECT_TRUE(failing.hasFailed());
        EXPECT_TRUE(server.hasError());
        EXPECT_FALSE(systemLines().empty());
        forgetSystemLog();
    }
    // A missing socket file need not be removed.
    const test::FailingCall failing("unlink", 1, EIO);
    test::HandlerSocket server;
    test::removeTree(test::LOCAL_SOCKET);
    EXPECT_TRUE(server.serverBind());
    EXPECT_TRUE(failing.hasFailed());
}

}  // namespace
