#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <sstream>
#include <thread>

#include "control.h"
#include "env_check.h"
#include "status.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::MonitordSocket;
using TERN::HA::Daemon::Status;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr char SOCKET[] = "/run/ternha/control.sock";

// A daemon's end of the control socket, answering from a record that the test sets.
class ControlServer {
 public:
    explicit ControlServer(Status& status) : _socket(SOCKET, 0) {
        _socket.setStatus(&status);
        EXPECT_TRUE(_socket.serverBind());
        _thread = std::thread([this] {
            while (!_isStopping) {
                _socket.serverListen();
            }
        });
    }

    ~ControlServer() {
        _isStopping = true;
        MonitordSocket(SOCKET, 5).isRebootRemote();
        _thread.join();
    }

 private:
    MonitordSocket _socket;
    std::atomic<bool> _isStopping{false};
    std::thread _thread;
};

// A listening socket whose connections the test answers itself.
class RawServer {
 public:
    RawServer() : _fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        std::string(SOCKET).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
        EXPECT_EQ(bind(_fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(listen(_fd, 10), 0);
    }

    ~RawServer() { close(_fd); }

    void answerOnce(const std::string& text) const {
        const int connection = accept4(_fd, nullptr, nullptr, SOCK_CLOEXEC);
        char request[64] = {};
        EXPECT_GT(recv(connection, request, sizeof request, 0), 0);
        EXPECT_EQ(send(connection, text.data(), text.size(), 0), static_cast<ssize_t>(text.size()));
        close(connection);
    }

 private:
    int _fd;
};

test::CommandResult shell(const std::string& command) {
    return test::run({"/bin/bash", "-c", "PATH=" TERNHACTL_DIR ":$PATH; exec 2>&1; " + command});
}

class TernhactlTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::makeDirectories("/run/ternha");
        test::SandboxTest::SetUp();
    }
};

void setState(Status& status, const Json::Value& state) {
    status.setRemoteAlive(state["peerAlive"].asBool());
    status.isRemoteMDResync = state["peerResync"].asBool();
    status.isRemoteDiskErrHandling = state["peerDiskErrors"].asBool();
    status.isMDResync = state["resync"].asBool();
    status.isDiskErrHandling = state["diskErrors"].asBool();
    status.isDRBDConnect = state["drbdConnected"].asBool();
    status.heartbeatLatency = state["latency"].asFloat();
    status.heartbeatPacketFailRate = state["nonOkRate"].asFloat();
    status.setErrHandlingDisk(state["disks"]);
    status.setErrHandlingDiskRemote(state["peerDisks"]);
    if (state["rebooting"].asBool()) {
        status.addRemoteNodeState(TERN::HA::Daemon::NodeRebootPending);
    }
}

// A transcript sets the daemon's record ("state JSON"), the table of the peer's disks ("disks JSON"), and
// then holds commands ("$ COMMAND"), each with what it prints and "exit CODE".
class Transcript : public TernhactlTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(Transcript, PrintsWhatItSays) {
    Status status;
    ControlServer server(status);
    std::istringstream script(test::readFile(TRANSCRIPTS_DIR "/" + GetParam() + ".txt"));
    std::string command;
    std::string expected;
    int commands = 0;
    std::string line;
    while (std::getline(script, line)) {
        Json::Value json;
        if (command.empty() && line.rfind("state ", 0) == 0) {
            std::istringstream(line.substr(6)) >> json;
            setState(status, json);
        } else if (command.empty() && line.rfind("disks ", 0) == 0) {
            test::writeFile("/tmp/ha/info_hd.remote", line.substr(6));
        } else if (line.rfind("$ ", 0) == 0) {
            command = line.substr(2);
            expected.clear();
        } else if (line.rfind("exit ", 0) == 0) {
            const auto result = shell(command);
            EXPECT_EQ(result.output, expected) << "of: " << command;
            EXPECT_EQ(result.exitCode, std::stoi(line.substr(5))) << "of: " << command;
            command.clear();
            ++commands;
        } else {
            expected += line + '\n';
        }
    }
    EXPECT_TRUE(command.empty()) << "without its exit line: " << command;
    EXPECT_GT(commands, 0);
}

INSTANTIATE_TEST_SUITE_P(Ternhactl, Transcript,
                         ::testing::Values("all_is_well", "trouble", "rebooting", "usage", "disk_names"),
                         [](const auto& transcript) { return transcript.param; });

TEST_F(TernhactlTest, SaysThatThereIsNoDaemonAndExitsWithThree) {
    for (const std::string command : {"status", "status --json", "rebooting", "disks", "reboot-peer --yes"}) {
        const auto result = shell("ternhactl " + command);
        EXPECT_EQ(result.exitCode, 3) << command;
        EXPECT_THAT(result.output,
                    EndsWith("ternhactl: ternhad does not answer on /run/ternha/control.sock: No such "
                             "file or directory\n"))
            << command;
    }
    const auto check = shell("ternhactl check");
    EXPECT_EQ(check.exitCode, 3);
    EXPECT_EQ(check.output, "TERNHA UNKNOWN - ternhad does not answer on /run/ternha/control.sock\n");

    const auto metrics = shell("ternhactl metrics");
    EXPECT_EQ(metrics.exitCode, 3);
    EXPECT_THAT(metrics.output, HasSubstr("\nternha_up 0\n"));
}

TEST_F(TernhactlTest, GivesUpOnASilentDaemonAfterItsTimeout) {
    const RawServer server;
    const test::Stopwatch stopwatch;
    const auto result = shell("ternhactl --timeout 1 status");
    EXPECT_GE(stopwatch.elapsed(), 1s);
    EXPECT_EQ(result.exitCode, 3);
    EXPECT_EQ(result.output, "ternhactl: ternhad does not answer on /run/ternha/control.sock\n");
}

TEST_F(TernhactlTest, TakesAnAnswerThatIsNoRecordForNone) {
    const RawServer server;
    std::thread answer([&server] { server.answerOnce("[1,2]"); });
    const auto result = shell("ternhactl status --json");
    answer.join();
    EXPECT_EQ(result.exitCode, 3);
}

TEST_F(TernhactlTest, ShowsNeutralValuesForFieldsOfWrongTypes) {
    const RawServer server;
    std::thread answer([&server] {
        server.answerOnce(R"({"isRemoteAlive":"yes","heartbeatLatency":[],"diskErrorHandlingDisk":[1,{}]})");
        server.answerOnce("{}");
    });
    const auto result = shell("ternhactl check");
    answer.join();
    EXPECT_EQ(
        result.output,
        "TERNHA CRITICAL - peer dead, DRBD not connected | latency=0.000ms;;;0 nonok=0.0000%;;;0;100\n");
    EXPECT_EQ(result.exitCode, 2);
}

TEST_F(TernhactlTest, ColoursOnlyATerminal) {
    Status status;
    const ControlServer server(status);
    EXPECT_THAT(shell("ternhactl status").output, Not(HasSubstr("\033")));
    EXPECT_THAT(shell("script -qec 'ternhactl status' /dev/null").output, HasSubstr("\033[31mdead\033[0m"));
    EXPECT_THAT(shell("NO_COLOR=1 script -qec 'ternhactl status' /dev/null").output, Not(HasSubstr("\033")));
}

TEST_F(TernhactlTest, WatchShowsChangesAsTheyCome) {
    Status status;
    const ControlServer server(status);
    test::Process watch({TERNHACTL_DIR "/ternhactl", "status", "--watch", "0.1"});
    EXPECT_TRUE(test::eventually(10s, [&] { return watch.output().find("dead") != std::string::npos; }));
    status.setRemoteAlive(true);
    EXPECT_TRUE(test::eventually(10s, [&] { return watch.output().find("alive") != std::string::npos; }));
    watch.signal(SIGINT);
    EXPECT_TRUE(watch.waitFor(5s).has_value());
}

TEST_F(TernhactlTest, AsksBeforeAReboot) {
    Status status;
    const ControlServer server(status);
    const auto refused = shell("echo n | ternhactl reboot-peer");
    EXPECT_EQ(refused.exitCode, 1);
    EXPECT_THAT(refused.output, EndsWith("Nothing done.\n"));
    const auto silent = shell("ternhactl reboot-peer </dev/null");
    EXPECT_EQ(silent.exitCode, 1);
    EXPECT_FALSE(status.isRemoteRebooting());
}

TEST_F(TernhactlTest, WaitsUntilThePeerIsDown) {
    remoteIP("127.0.0.2");
    Status status;
    const ControlServer server(status);
    const test::Stopwatch stopwatch;
    const auto result = shell("ternhactl reboot-peer --yes");
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_GE(stopwatch.elapsed(), 3s);
    EXPECT_THAT(result.output, EndsWith("The peer counts as rebooting until it answers again.\n"));
    EXPECT_EQ(status.getRemoteNodeState(), TERN::HA::Daemon::NodeRebooting);
}

std::string completionOf(const std::string& words) {
    return shell("complete() { :; }; source " COMPLETION_FILE "; COMP_WORDS=(" + words +
                 "); COMP_CWORD=$((${#COMP_WORDS[@]} - 1)); _ternhactl; echo ${COMPREPLY[*]}")
        .output;
}

TEST_F(TernhactlTest, CompletesCommandsAndTheirOptions) {
    EXPECT_EQ(completionOf("ternhactl re"), "rebooting reboot-peer\n");
    EXPECT_EQ(completionOf("ternhactl status --"), "--json --watch --socket --timeout --help\n");
    EXPECT_EQ(completionOf("ternhactl --timeout 3 reboot-peer --y"), "--yes\n");
    EXPECT_EQ(completionOf("ternhactl metrics --y"), "\n");
}

}  // namespace
