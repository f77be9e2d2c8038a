#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <mutex>
#include <optional>
#include <ostream>
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

constexpr char SOCKET[] = "/run/ternha/control.sock";

std::mutex reportMutex;  // guards the report that a test changes while its server runs

// A daemon's end of the control socket, answering from a record that the test sets. With a report it is a
// daemon of this version, without one an older daemon.
class ControlServer {
 public:
    explicit ControlServer(Status& status, const Json::Value* report = nullptr) : _socket(report) {
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
    class Socket : public MonitordSocket {
     public:
        explicit Socket(const Json::Value* report) : MonitordSocket(SOCKET, 0), _report(report) {}

        bool serverHandle(const Json::Value& request, Json::Value& reply) override {
            const std::lock_guard<std::mutex> lock(reportMutex);
            if (request["act"] == "S" && _report != nullptr && !_report->isNull()) {
                reply = *_report;
                return true;
            }
            return MonitordSocket::serverHandle(request, reply);
        }

     private:
        const Json::Value* _report;
    };

    Socket _socket;
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

    bool isWaitedFor() const {
        pollfd state = {_fd, POLLIN, 0};
        return poll(&state, 1, 0) > 0;
    }

    // Takes the next client's request.
    int accept() const {
        const int connection = accept4(_fd, nullptr, nullptr, SOCK_CLOEXEC);
        char request[64] = {};
        EXPECT_GT(recv(connection, request, sizeof request, 0), 0);
        return connection;
    }

    static void send(int connection, const std::string& text) {
        EXPECT_EQ(::send(connection, text.data(), text.size(), 0), static_cast<ssize_t>(text.size()));
    }

    void answerOnce(const std::string& text) const {
        const int connection = accept();
        send(connection, text);
        close(connection);
    }

 private:
    int _fd;
};

test::CommandResult shell(const std::string& command) {
    return test::run(
        {"/bin/bash", "-c", "PATH=" TERNHACTL_DIR ":$PATH; export TZ=UTC; exec 2>&1; " + command});
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

// A transcript sets the daemon's record ("state JSON") or its report ("report JSON"), the table of the peer's
// disks ("disks JSON"), and then holds commands ("$ COMMAND"), each with what it prints and "exit CODE".
class Transcript : public TernhactlTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(Transcript, PrintsWhatItSays) {
    Status status;
    Json::Value report;
    ControlServer server(status, &report);
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
            const std::lock_guard<std::mutex> lock(reportMutex);
            report = Json::Value();
        } else if (command.empty() && line.rfind("report ", 0) == 0) {
            const std::lock_guard<std::mutex> lock(reportMutex);
            std::istringstream(line.substr(7)) >> report;
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
                         ::testing::Values("all_is_well", "disk_names", "never_measured", "no_kernel_files",
                                           "older_daemon", "peer_dead", "rebooting", "trouble",
                                           "unsafe_failover", "usage"),
                         [](const auto& transcript) { return transcript.param; });

TEST_F(TernhactlTest, ExitsWith3WithoutADaemon) {
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
    EXPECT_EQ(check.output,
              "TERNHA UNKNOWN - ternhad does not answer on /run/ternha/control.sock: No such "
              "file or directory\n");

    const auto metrics = shell("ternhactl metrics");
    EXPECT_EQ(metrics.exitCode, 3);
    EXPECT_THAT(metrics.output, HasSubstr("\nternha_up 0\n"));
}

TEST_F(TernhactlTest, SilentDaemonEndsInATimeout) {
    const RawServer server;
    const test::Stopwatch stopwatch;
    const auto result = shell("ternhactl --timeout 1 status");
    EXPECT_GE(stopwatch.elapsed(), 1s);
    EXPECT_EQ(result.exitCode, 3);
    EXPECT_EQ(result.output,
              "ternhactl: ternhad does not answer on /run/ternha/control.sock: no reply within 1 s\n");
}

TEST_F(TernhactlTest, FullBacklogEndsInATimeout) {
    const RawServer server;
    std::vector<test::Process> waiting;  // fill the queue
    for (int i = 0; i < 12; ++i) {
        waiting.emplace_back(
            std::vector<std::string>{TERNHACTL_DIR "/ternhactl", "--timeout", "60", "status"});
    }
    const auto isFull = [] {
        const auto result = shell("ternhactl --timeout 1 status");
        return result.output.find("temporarily unavailable") != std::string::npos;
    };
    ASSERT_TRUE(test::eventually(20s, isFull));
    const test::Stopwatch stopwatch;
    EXPECT_EQ(shell("ternhactl --timeout 5 status").exitCode, 3);
    EXPECT_LT(stopwatch.elapsed(), 9s);  // one timeout, not one for each step
}

TEST_F(TernhactlTest, HalfAReplyEndsInATimeout) {
    const RawServer server;
    const test::Stopwatch stopwatch;
    test::Process status({TERNHACTL_DIR "/ternhactl", "--timeout", "5", "status"});
    const int connection = server.accept();
    RawServer::send(connection, R"({"version":1,)");
    EXPECT_EQ(test::resultOf(std::move(status)).exitCode, 3);
    EXPECT_LT(stopwatch.elapsed(), 9s);
    close(connection);
}

// A daemon that sends each of its clients `part` again and again, and never ends a reply.
class EndlessServer {
 public:
    explicit EndlessServer(std::string part, std::chrono::milliseconds pause)
        : _thread([this, part = std::move(part), pause] { run(part, pause); }) {}

    ~EndlessServer() {
        _isStopping = true;
        _thread.join();
    }

    EndlessServer(const EndlessServer&) = delete;
    EndlessServer& operator=(const EndlessServer&) = delete;

 private:
    void run(const std::string& part, std::chrono::milliseconds pause) const {
        std::vector<int> clients;
        while (!_isStopping) {
            while (_server.isWaitedFor()) {
                clients.push_back(_server.accept());
            }
            for (const int client : clients) {
                ::send(client, part.data(), part.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
            }
            std::this_thread::sleep_for(pause);
        }
        for (const int client : clients) {
            close(client);
        }
    }

    RawServer _server;
    std::atomic<bool> _isStopping{false};
    std::thread _thread;
};

struct EndlessReply {
    const char* name;
    std::string part;
    std::chrono::milliseconds pause;
};

void PrintTo(const EndlessReply& reply, std::ostream* stream) {
    *stream << reply.name;
}

class EndlessReplyTest : public TernhactlTest, public ::testing::WithParamInterface<EndlessReply> {};

TEST_P(EndlessReplyTest, EveryCommandEndsWithinItsTimeout) {
    const EndlessServer server(GetParam().part, GetParam().pause);
    std::vector<test::Process> commands;
    for (const std::string command : {"status", "status --json", "disks", "check", "metrics", "rebooting",
                                      "wait peer-alive", "events", "reboot-peer --yes"}) {
        commands.emplace_back(std::vector<std::string>{
            "/bin/bash", "-c", "exec " TERNHACTL_DIR "/ternhactl --timeout 1 " + command});
    }
    for (test::Process& command : commands) {
        const auto status = command.waitFor(10s);
        ASSERT_TRUE(status.has_value());
        EXPECT_EQ(WEXITSTATUS(*status), 3);
    }
}

INSTANTIATE_TEST_SUITE_P(Replies, EndlessReplyTest,
                         ::testing::Values(EndlessReply{"None", "", 20ms},
                                           EndlessReply{"SlowBytes", " ", 100ms},
                                           EndlessReply{"Flood", std::string(65536, ' '), 0ms}),
                         [](const auto& reply) { return reply.param.name; });

TEST_F(TernhactlTest, ReportsTheCauseWhenTheDaemonDoesNotReply) {
    const auto reason = [](const std::string& command) {
        const std::string output = shell(command).output;
        return output.substr(output.rfind(": ") + 2);
    };
    EXPECT_EQ(reason("ternhactl --socket /tmp disks"), "Connection refused\n");
    EXPECT_EQ(reason("ternhactl --socket /etc/hosts/x disks"), "Not a directory\n");
    EXPECT_EQ(reason("ternhactl --socket /" + std::string(107, 'x') + " disks"),
              "longer than 107 characters\n");
    RawServer{};
    EXPECT_EQ(reason("ternhactl disks"), "Connection refused\n");
}

TEST_F(TernhactlTest, ReportsThatTheSocketIsNotAccessible) {
    if (!test::hasOtherUsers()) {
        GTEST_SKIP() << "needs users other than root";
    }
    test::makeDirectories("/run/private");
    ASSERT_EQ(chmod("/run/private", 0), 0);
    const auto result = shell("setpriv --reuid 65534 --clear-groups ternhactl --socket /run/private/x disks");
    EXPECT_THAT(result.output, EndsWith(": Permission denied\n"));
}

TEST_F(TernhactlTest, ReportsOutputErrors) {
    Status status;
    const ControlServer server(status);
    Json::Value disks(Json::arrayValue);
    disks.append("sda");
    status.setErrHandlingDisk(disks);
    for (const std::string command : {"status", "status --json", "rebooting", "disks", "metrics", "--help"}) {
        const auto result = shell("ternhactl " + command + " >/dev/full");
        EXPECT_EQ(result.exitCode, 74) << command;
        EXPECT_EQ(result.output, "ternhactl: cannot write to standard output: No space left on device\n")
            << command;
    }
    for (const std::string command : {"--version", "check --help", "status --watch 0.1"}) {
        const auto result = shell("ternhactl " + command + " >/dev/full");
        EXPECT_EQ(result.exitCode, 74) << command;
        EXPECT_EQ(result.output, "ternhactl: cannot write to standard output: No space left on device\n")
            << command;
    }
    for (const std::string command : {"check", "check --frobnicate"}) {
        EXPECT_EQ(shell("ternhactl " + command + " >/dev/full").exitCode, 3) << command;
    }
    const auto file = shell("ternhactl metrics --output /nowhere/ternha.prom");
    EXPECT_EQ(file.exitCode, 74);
    EXPECT_EQ(file.output, "ternhactl: cannot write /nowhere/ternha.prom: No such file or directory\n");
}

TEST_F(TernhactlTest, ReplacesAMetricsFileAtomically) {
    Status status;
    const ControlServer server(status);
    test::writeFile("/tmp/ternha.prom", "old\n");
    test::Process collector(
        {"/bin/bash", "-c",
         "for ((i = 0; i < 2000; i++)); do read -r line </tmp/ternha.prom || echo empty; done"});
    for (int i = 0; i < 20; ++i) {
        EXPECT_EQ(shell("umask 077; ternhactl metrics --output /tmp/ternha.prom").exitCode, 0);
    }
    EXPECT_EQ(test::resultOf(std::move(collector)).output, "");
    EXPECT_EQ(test::readFile("/tmp/ternha.prom"), shell("ternhactl metrics").output);
    EXPECT_EQ(shell("stat -c %a /tmp/ternha.prom; ls /tmp/*.prom*").output, "644\n/tmp/ternha.prom\n");
    // Whatever else has a name like it.
    test::makeDirectories("/tmp/ternha.prom.new");
    EXPECT_EQ(shell("ternhactl metrics --output /tmp/ternha.prom").exitCode, 0);
}

TEST_F(TernhactlTest, RejectsAnInvalidReply) {
    const RawServer server;
    for (const std::string reply : {"[1,2]", "{", "nonsense"}) {
        std::thread answer([&] { server.answerOnce(reply); });
        const auto result = shell("ternhactl status");
        answer.join();
        EXPECT_EQ(result.exitCode, 3);
        EXPECT_THAT(result.output, EndsWith(": the reply is not ternhad's\n"));
    }
}

TEST_F(TernhactlTest, ShowsMissingAndMistypedFieldsAsUnknown) {
    const RawServer server;
    std::thread answer([&server] {
        server.answerOnce(R"({"version":1,"peer":{"alive":{"value":"yes"},"disks":7},"node":[],)"
                          R"("link":{"latency":{"value":[]},"connected":1}})");
    });
    const auto result = shell("ternhactl check");
    answer.join();
    EXPECT_EQ(result.output,
              "TERNHA UNKNOWN - peer has not replied yet, DRBD not checked yet, this node not checked yet | "
              "latency=U;;;0 nonok=U;;;0;100\n");
    EXPECT_EQ(result.exitCode, 3);
}

TEST_F(TernhactlTest, UsesColourOnATerminalOnly) {
    Status status;
    const ControlServer server(status);
    EXPECT_THAT(shell("ternhactl status").output, Not(HasSubstr("\033")));
    const std::string coloured = shell("script -qec 'ternhactl status' /dev/null").output;
    EXPECT_THAT(coloured, HasSubstr("\033[31mdead\033[0m"));
    EXPECT_THAT(coloured, HasSubstr("RAID resync       \033[2mno (last known)\033[0m"));
    EXPECT_THAT(coloured, HasSubstr("being rebooted    no\r\n"));
    EXPECT_THAT(shell("NO_COLOR=1 script -qec 'ternhactl status' /dev/null").output, Not(HasSubstr("\033")));
}

TEST_F(TernhactlTest, WatchShowsChangesAndKeepsTheLastStatusWhenTheDaemonStops) {
    Status status;
    auto server = std::make_unique<ControlServer>(status);
    test::Process watch({TERNHACTL_DIR "/ternhactl", "status", "--watch", "0.1"});
    const auto shows = [&watch](const std::string& text) {
        return test::eventually(10s, [&] { return watch.output().find(text) != std::string::npos; });
    };
    EXPECT_TRUE(shows("dead"));
    status.setRemoteAlive(true);
    EXPECT_TRUE(shows("alive"));
    EXPECT_TRUE(shows("  latency           ·"));
    status.heartbeatLatency = 1.0;
    EXPECT_TRUE(shows("·█"));
    status.heartbeatLatency = 0.5;
    EXPECT_TRUE(shows("█▄"));
    server.reset();
    EXPECT_TRUE(
        shows("ternhad does not answer on /run/ternha/control.sock: Connection refused\nLast status, "));
    const std::string output = watch.output();
    EXPECT_THAT(output.substr(output.rfind("Last status, ")), HasSubstr("  state             alive\n"));
    server = std::make_unique<ControlServer>(status);
    EXPECT_TRUE(test::eventually(10s, [&] {
        const std::string text = watch.output();
        return text.rfind("this node <-> peer: ") > text.rfind("Last status, ") + 100;
    }));
    EXPECT_THAT(watch.output(),
                ::testing::ContainsRegex("(^|\n)[0-2][0-9]:[0-5][0-9]:[0-6][0-9]\nthis node"));
    watch.signal(SIGINT);
    EXPECT_TRUE(watch.waitFor(5s).has_value());
}

TEST_F(TernhactlTest, RebootAsksForConfirmation) {
    Status status;
    const ControlServer server(status);
    const auto refused = shell("echo n | ternhactl reboot-peer");
    EXPECT_EQ(refused.exitCode, 1);
    EXPECT_THAT(refused.output, EndsWith("Nothing done.\n"));
    const auto silent = shell("ternhactl reboot-peer </dev/null");
    EXPECT_EQ(silent.exitCode, 1);
    EXPECT_FALSE(status.isRemoteRebooting());
}

TEST_F(TernhactlTest, ReportsTheOutcomeOfAReboot) {
    remoteIP("127.0.0.2");
    Status status;
    const ControlServer server(status);
    const auto dead = shell("ternhactl reboot-peer --yes");
    EXPECT_EQ(dead.exitCode, 1);
    EXPECT_THAT(dead.output, EndsWith("The peer was already dead: it may not have received the request.\n"));

    status.setRemoteAlive(true);
    test::Process obeyed({"/bin/bash", "-c", TERNHACTL_DIR "/ternhactl reboot-peer --yes"});
    EXPECT_TRUE(test::eventually(10s, [&] { return status.isRemoteRebooting(); }));
    status.setRemoteAlive(false);
    const auto result = test::resultOf(std::move(obeyed));
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_THAT(result.output, HasSubstr("The peer went down, or the link to it."));
    EXPECT_THAT(result.output, EndsWith("It counts as rebooting until it replies again.\n"));
    EXPECT_EQ(status.getRemoteNodeState(), TERN::HA::Daemon::NodeRebooting);
}

TEST_F(TernhactlTest, ReportsAPeerThatWasNotRebooted) {
    const RawServer server;
    const std::string report = R"({"version":1,"peer":{"alive":{"value":true}}})";
    std::thread answer([&] {
        server.answerOnce(report);
        server.answerOnce("null");
        server.answerOnce(report);
    });
    const auto result = shell("ternhactl reboot-peer --yes");
    answer.join();
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_THAT(result.output, EndsWith("The peer still answers: it was not rebooted.\n"));
}

TEST_F(TernhactlTest, ReportsAnOrderWhoseOutcomeIsUnknown) {
    const std::string report = R"({"version":1,"peer":{"alive":{"value":true}}})";
    const std::string silence = "ternhactl: ternhad does not answer on /run/ternha/control.sock: ";
    for (const bool isCarriedOut : {true, false}) {
        std::optional<RawServer> server(std::in_place);
        std::thread answer([&] {
            server->answerOnce(report);
            server->answerOnce(isCarriedOut ? "null" : "");
            server.reset();  // as a daemon that has ended
            test::removeTree(SOCKET);
        });
        const auto result = shell("ternhactl reboot-peer --yes");
        answer.join();
        EXPECT_EQ(result.exitCode, 2);
        EXPECT_THAT(result.output, HasSubstr(silence));
        EXPECT_THAT(result.output,
                    EndsWith(isCarriedOut ? "the reboot request was carried out, its outcome is unknown\n"
                                          : "the reboot request was sent, its outcome is unknown\n"));
    }
}

TEST_F(TernhactlTest, RefusesASecondRebootMeanwhile) {
    Status status;
    status.setRemoteAlive(true);
    status.addRemoteNodeState(TERN::HA::Daemon::NodeRebootPending);
    const ControlServer server(status);
    const auto result = shell("ternhactl reboot-peer --yes");
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "The peer is being rebooted already. Nothing done.\n");
}

constexpr char EVENTS[] =
    "{\"version\":1,\"peer\":{\"alive\":{\"value\":true}}}\n"
    "{\"event\":\"resync\",\"new\":\"resync\",\"old\":\"no-resync\",\"time\":0}\n"
    "{\"event\":\"peer\",\"new\":\"peer-dead\",\"old\":\"peer-alive\",\"time\":60}\n";

TEST_F(TernhactlTest, PrintsEventsUntilTheDaemonEnds) {
    const RawServer server;
    for (const std::string option : {"", " --json"}) {
        std::thread answer([&server] { server.answerOnce(EVENTS); });
        const auto result = shell("ternhactl events" + option);
        answer.join();
        EXPECT_EQ(result.exitCode, 3);
        EXPECT_EQ(result.output,
                  (option.empty() ? "1970-01-01T00:00:00+0000 resync (was no-resync)\n"
                                    "1970-01-01T00:01:00+0000 peer-dead (was peer-alive)\n"
                                  : std::string(EVENTS).substr(std::string(EVENTS).find('\n') + 1)) +
                      "ternhactl: ternhad does not answer on /run/ternha/control.sock: the connection was "
                      "closed\n");
    }
}

TEST_F(TernhactlTest, ReportsLostEventsAndWaitsOn) {
    const RawServer server;
    const std::string lost = "{\"version\":1}\n{\"count\":12,\"event\":\"lost\",\"time\":60}\n";
    std::thread answer([&] { server.answerOnce(lost); });
    EXPECT_THAT(shell("ternhactl events").output, HasSubstr("1970-01-01T00:01:00+0000 12 changes lost\n"));
    answer.join();
    // The condition may have come true among them.
    std::thread answers([&] {
        server.answerOnce(lost);
        server.answerOnce(std::string(EVENTS).substr(0, std::string(EVENTS).find('\n') + 1));
    });
    EXPECT_EQ(shell("ternhactl wait peer-alive").exitCode, 0);
    answers.join();
}

TEST_F(TernhactlTest, ReportsOutputErrorsOfEvents) {
    const RawServer server;
    std::thread answer([&server] { server.answerOnce(EVENTS); });
    const auto result = shell("ternhactl events >/dev/full");
    answer.join();
    EXPECT_EQ(result.exitCode, 74);
    EXPECT_EQ(result.output, "ternhactl: cannot write to standard output: No space left on device\n");
}

TEST_F(TernhactlTest, WaitsUntilAConditionHolds) {
    const RawServer server;
    const auto waitFor = [&server](const std::string& arguments) {
        std::thread answer([&server] { server.answerOnce(EVENTS); });
        const auto result = shell("ternhactl wait " + arguments);
        answer.join();
        return result.exitCode;
    };
    EXPECT_EQ(waitFor("peer-alive"), 0);  // holds already
    EXPECT_EQ(waitFor("peer-dead"), 0);   // a change
    EXPECT_EQ(waitFor("connected"), 3);   // the daemon ended first
    EXPECT_EQ(waitFor("resync --timeout 600"), 0);
}

TEST_F(TernhactlTest, WaitEndsAtItsTimeout) {
    const RawServer server;
    std::thread answer([&server] {
        const int connection = server.accept();
        server.send(connection, "{\"version\":1}\n");
        char end = 0;
        EXPECT_EQ(recv(connection, &end, 1, 0), 0);  // until the client closes
        close(connection);
    });
    const auto result = shell("ternhactl wait peer-alive --timeout 0.3");
    answer.join();
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "ternhactl: not in time: peer-alive\n");
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
    EXPECT_EQ(completionOf("ternhactl metrics --o"), "--output\n");
    EXPECT_EQ(completionOf("ternhactl check --s"), "--self --socket\n");
    std::istringstream offered(completionOf("ternhactl wait ''"));
    for (std::string condition; offered >> condition;) {
        EXPECT_THAT(shell("ternhactl wait " + condition).output, HasSubstr("No such file")) << condition;
    }
}

}  // namespace
