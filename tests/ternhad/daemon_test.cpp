#include "ternhad/daemon.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <map>
#include <system_error>
#include <thread>

#include "support/sandbox.h"
#include "support/udp.h"

namespace {

using namespace std::chrono_literals;
using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::Not;

mode_t modeOf(const char* path) {
    struct stat info = {};
    EXPECT_EQ(stat(path, &info), 0) << path;
    return info.st_mode & 07777;
}

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__) || defined(TERNHAD_IS_WRAPPED)
constexpr auto STOP_LIMIT = 20s;  // sanitizers and valgrind have their own work at the end of a process
#else
constexpr auto STOP_LIMIT = 2s;
#endif

// One daemon on 127.0.0.1 whose peer, 127.0.0.2, nobody plays unless a test does.
class DaemonTest : public ::testing::Test {
 protected:
    static test::Process start(const std::vector<std::string>& more = {}) {
        return test::Process(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo", more));
    }

    static bool isUp() { return !test::statusAt().isNull(); }

    static test::Process startAndWait(const std::vector<std::string>& more = {}) {
        test::Process daemon = start(more);
        EXPECT_TRUE(test::eventually(10s, isUp)) << daemon.error();
        return daemon;
    }

    // Until it listens for the peer's questions, too: those that come before are lost.
    static void waitForReplies() {
        test::UdpSocket asker("127.0.0.4");
        EXPECT_TRUE(test::eventually(10s, [&asker] {
            asker.send("is_alive", "127.0.0.1", 7499);
            return asker.receive(50ms).has_value();
        }));
    }

    // Ends it as a supervisor does and expects what that may expect.
    static void stop(test::Process& daemon, int signal = SIGTERM) {
        const test::Stopwatch stopwatch;
        daemon.signal(signal);
        const auto status = daemon.waitFor(20s);
        EXPECT_LT(stopwatch.elapsed(), STOP_LIMIT);
        ASSERT_TRUE(status.has_value());
        EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << *status;
    }
};

TEST_F(DaemonTest, CreatesPrivateDirectoriesAndSocket) {
    auto daemon = startAndWait();
    EXPECT_EQ(modeOf("/tmp/ha"), 0700U);
    EXPECT_EQ(modeOf("/var/log/ha"), 0700U);
    EXPECT_EQ(modeOf("/run/ternha"), 0700U);
    EXPECT_EQ(modeOf(test::CONTROL_SOCKET), 0700U);
    ASSERT_TRUE(test::eventually(10s, [] { return test::exists("/tmp/ha/ha.daemon.log"); }));
    EXPECT_EQ(modeOf("/tmp/ha/ha.daemon.log"), 0600U);
    stop(daemon);
}

TEST_F(DaemonTest, KeepsExistingDirectories) {
    test::makeDirectories("/var/log/ha");
    ASSERT_EQ(chmod("/var/log/ha", 0750), 0);
    auto daemon = startAndWait();
    EXPECT_EQ(modeOf("/var/log/ha"), 0750U);
    stop(daemon);
}

void expectRefusal(const std::string& reason) {
    const auto result = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.error, "ternhad: /tmp/ha: " + reason + "\n");
    EXPECT_FALSE(test::exists(test::CONTROL_SOCKET));
}

TEST_F(DaemonTest, RefusesASymbolicLinkAsBufferDirectory) {
    test::makeDirectories("/tmp/elsewhere");
    std::filesystem::create_symlink("/tmp/elsewhere", "/tmp/ha");
    expectRefusal("not a directory");
}

TEST_F(DaemonTest, RefusesAFileAsBufferDirectory) {
    test::writeFile("/tmp/ha", "");
    expectRefusal("not a directory");
}

TEST_F(DaemonTest, RefusesABufferDirectoryOfAnotherUser) {
    test::makeDirectories("/tmp/ha");
    if (chown("/tmp/ha", 1000, 1000) != 0) {
        // No other user is known in a sandbox of an ordinary one, but the machine's root owns /usr.
        ASSERT_EQ(mount("/usr/bin", "/tmp/ha", nullptr, MS_BIND, nullptr), 0);
    }
    expectRefusal("belongs to another user");
}

TEST_F(DaemonTest, RefusesAWorldWritableBufferDirectory) {
    test::makeDirectories("/tmp/ha");
    ASSERT_EQ(chmod("/tmp/ha", 0777), 0);
    expectRefusal("others can write to it");
}

TEST_F(DaemonTest, RefusesABufferDirectoryWithALinkInIt) {
    test::makeDirectories("/tmp/ha");
    ASSERT_EQ(chmod("/tmp/ha", 0700), 0);
    test::writeFile("/tmp/secret", "kept");
    std::filesystem::create_symlink("/tmp/secret", "/tmp/ha/ha.daemon.log");
    const auto result = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.error, "ternhad: /tmp/ha/ha.daemon.log: neither a file nor a directory\n");
    EXPECT_EQ(test::readFile("/tmp/secret"), "kept");
}

TEST_F(DaemonTest, RefusesABufferDirectoryWithAFifoInIt) {
    test::makeDirectories("/tmp/ha");
    ASSERT_EQ(chmod("/tmp/ha", 0700), 0);
    ASSERT_EQ(mkfifo("/tmp/ha/ha.daemon.record", 0600), 0);
    const auto result = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.error, "ternhad: /tmp/ha/ha.daemon.record: neither a file nor a directory\n");
}

TEST_F(DaemonTest, AcceptsItsOwnBufferDirectory) {
    test::makeDirectories("/tmp/ha");
    ASSERT_EQ(chmod("/tmp/ha", 0700), 0);
    test::writeFile("/tmp/ha/info_hd.remote", "{}");
    auto daemon = startAndWait();
    stop(daemon);
    EXPECT_EQ(test::readFile("/tmp/ha/info_hd.remote"), "{}");
}

TEST_F(DaemonTest, WarnsOfAnInterfaceThatDoesNotExist) {
    test::Process daemon(test::daemonArguments("127.0.0.1", "127.0.0.2", "eth9"));
    EXPECT_TRUE(test::eventually(10s, isUp)) << daemon.error();
    EXPECT_THAT(daemon.error(), HasSubstr("there is no network interface eth9 (yet)"));
    stop(daemon);
}

// Connects as another user. Returns 0, the error number, or -1 in a sandbox that knows no other user.
int connectAsAnotherUser() {
    int error = -1;
    std::thread([&error] {
        // The bare system calls change this thread alone.
        if (syscall(SYS_setgroups, 0, nullptr) != 0 || syscall(SYS_setresgid, 1000, 1000, 1000) != 0 ||
            syscall(SYS_setresuid, 1000, 1000, 1000) != 0) {
            return;
        }
        try {
            test::connectedClient();
            error = 0;
        } catch (const std::system_error& failure) {
            error = failure.code().value();
        }
    }).join();
    return error;
}

TEST_F(DaemonTest, AnotherUserCannotReachTheSocket) {
    auto daemon = startAndWait();
    const int error = connectAsAnotherUser();
    EXPECT_TRUE(error == EACCES || error == -1) << error;
    // Nor when only the socket's own mode is left to keep others out.
    ASSERT_EQ(chmod("/run/ternha", 0755), 0);
    EXPECT_EQ(connectAsAnotherUser(), error);
    ASSERT_EQ(chmod(test::CONTROL_SOCKET, 0666), 0);
    EXPECT_EQ(connectAsAnotherUser(), error == EACCES ? 0 : -1);
    stop(daemon);
}

// A connection over which nothing is sent.
class SilentClient {
 public:
    // What the daemon has sent when it has closed the connection.
    std::string receiveAll() const {
        std::string all(4096, '\0');
        all.resize(
            static_cast<std::size_t>(std::max(recv(_fd.get(), all.data(), all.size(), 0), ssize_t{0})));
        return all;
    }

 private:
    test::Descriptor _fd = test::connectedClient();
};

TEST_F(DaemonTest, SilentClientsDelayNobodyAndAreDroppedAfterFiveSeconds) {
    auto daemon = startAndWait();
    const test::Stopwatch stopwatch;
    const std::vector<SilentClient> silent(15);
    EXPECT_TRUE(isUp());
    EXPECT_LT(stopwatch.elapsed(), 4s);
    for (const SilentClient& client : silent) {
        EXPECT_EQ(client.receiveAll(), "");
    }
    EXPECT_GE(stopwatch.elapsed(), 4s);
    EXPECT_LT(stopwatch.elapsed(), 15s);
    stop(daemon);
}

TEST_F(DaemonTest, RemovedControlSocketIsCreatedAgain) {
    auto daemon = startAndWait();
    test::removeTree(test::CONTROL_SOCKET);
    EXPECT_TRUE(test::eventually(15s, isUp));
    stop(daemon);
}

TEST_F(DaemonTest, ControlSocketThatCannotBeCreatedAgainIsLoggedOnce) {
    auto daemon = startAndWait();
    test::removeTree(test::CONTROL_SOCKET);
    test::writeFile(test::CONTROL_SOCKET, "");
    const std::string line = "Cannot create the missing socket: File exists\n";
    EXPECT_TRUE(test::eventually(15s, [&] { return test::wholeLog().find(line) != std::string::npos; }));
    EXPECT_FALSE(test::eventually(6s, [&] {
        const std::string log = test::wholeLog();
        return log.find(line) != log.rfind(line);
    }));
    test::removeTree(test::CONTROL_SOCKET);
    EXPECT_TRUE(test::eventually(15s, isUp));
    stop(daemon);
}

TEST_F(DaemonTest, RemovedSocketDirectoryIsCreatedAgain) {
    const std::string statusSocket = "/run/ternha/status.sock";
    for (const bool hasStatusSocket : {false, true}) {
        auto daemon = startAndWait(hasStatusSocket ? std::vector<std::string>{"--status-socket", statusSocket,
                                                                              "--status-group", "root"}
                                                   : std::vector<std::string>());
        test::removeTree("/run/ternha");
        EXPECT_TRUE(test::eventually(15s, isUp));
        EXPECT_EQ(modeOf("/run/ternha"), hasStatusSocket ? 0711U : 0700U);
        EXPECT_EQ(modeOf(test::CONTROL_SOCKET), 0700U);
        if (hasStatusSocket) {
            EXPECT_TRUE(test::eventually(15s, [&] { return !test::statusAt(statusSocket).isNull(); }));
        }
        stop(daemon);
    }
}

TEST_F(DaemonTest, SecondInstanceExitsAndLeavesTheFirstAlone) {
    auto daemon = startAndWait();
    const auto second = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(second.exitCode, 3);
    EXPECT_EQ(second.error, "ternhad: already running as process " + std::to_string(daemon.pid()) + "\n");
    EXPECT_TRUE(isUp());
    stop(daemon);
}

TEST_F(DaemonTest, ServesAThousandClientsInARow) {
    auto daemon = startAndWait();
    for (int i = 0; i < 1000; ++i) {
        ASSERT_TRUE(test::statusAt().isObject()) << i;
    }
    stop(daemon);
}

TEST_F(DaemonTest, ServesAHundredClientsAtOnceAlthoughSomeDisconnect) {
    auto daemon = startAndWait();
    std::atomic<int> served{0};
    std::vector<std::thread> clients;
    for (int i = 0; i < 100; ++i) {
        clients.emplace_back([&served, i] {
            if (i % 10 == 0) {
                const SilentClient leaving;
            } else if (Json::Value status;
                       TERN::HA::Daemon::MonitordSocket(test::CONTROL_SOCKET, 60).getServerData(status)) {
                ++served;
            }
        });
    }
    for (std::thread& client : clients) {
        client.join();
    }
    EXPECT_EQ(served, 90);
    EXPECT_TRUE(isUp());
    stop(daemon);
}

TEST_F(DaemonTest, CommandLineOverridesTheConfigurationFile) {
    test::writeFile("/tmp/ternhad.conf",
                    "# of this node\nlocal-ip = 127.0.0.1\nremote-ip = 127.0.0.9\ninterface = lo\n"
                    "socket = /run/other/control.sock\n");
    test::Process daemon({TERNHAD, "--config", "/tmp/ternhad.conf", "--remote-ip", "127.0.0.2"});
    EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt("/run/other/control.sock").isNull(); }))
        << daemon.error();
    const auto isStarted = Contains(test::LogLine("daemon.cpp", "Started on 127.0.0.1, peer 127.0.0.2"));
    EXPECT_TRUE(test::eventually(
        10s, [&] { return ::testing::Matches(isStarted)(test::messages(test::wholeLog())); }));
    stop(daemon);
}

class StopTest : public DaemonTest, public ::testing::WithParamInterface<int> {};

TEST_P(StopTest, MovesTheLogToDiskAndRemovesTheSocket) {
    auto daemon = startAndWait();
    stop(daemon, GetParam());
    EXPECT_FALSE(test::exists(test::CONTROL_SOCKET));
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_EQ(test::recordText(), "");
    const auto messages = test::messages(test::readFile("/var/log/ha/ha.daemon.log"));
    EXPECT_THAT(messages, Contains(test::LogLine("daemon.cpp", "Started on 127.0.0.1, peer 127.0.0.2")));
    EXPECT_THAT(messages, Contains(test::LogLine("daemon.cpp", "Stopping")));
}

INSTANTIATE_TEST_SUITE_P(Signals, StopTest, ::testing::Values(SIGTERM, SIGINT));

TEST_F(DaemonTest, AStoppedCheckDoesNotDeclareThePeerDead) {
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    const auto question = peer.receive(10s);
    ASSERT_TRUE(question.has_value());
    peer.send("alive", question->address, question->port);
    ASSERT_TRUE(test::eventually(10s, [] { return test::statusAt()["isRemoteAlive"].asBool(); }));
    ASSERT_TRUE(peer.receive(10s).has_value());  // the next question: left unanswered
    stop(daemon);
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
}

TEST_F(DaemonTest, SlowPingDoesNotDelayTheStop) {
    test::replaceProgram("/bin/ping", ": > /tmp/pinging; exec sleep 60");
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    ASSERT_TRUE(test::eventually(20s, [&] {
        if (const auto question = peer.receive(10ms)) {
            peer.send(question->bytes == "is_alive" ? "alive" : "{}", question->address, question->port);
        }
        return test::exists("/tmp/pinging");
    }));
    stop(daemon);
    EXPECT_NE(test::run({"pgrep", "sleep"}).exitCode, 0);
}

TEST_F(DaemonTest, SighupMovesAndRotatesTheLogs) {
    auto daemon = startAndWait({"--log-interval", "3600"});
    daemon.signal(SIGHUP);
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::exists("/var/log/ha/ha.daemon.log.0.xz") &&
               test::exists("/var/log/ha/ha.daemon.record.0.xz");
    }));
    const auto xz = test::run({"xz", "-dc", "/var/log/ha/ha.daemon.log.0.xz"});
    EXPECT_THAT(xz.output, HasSubstr("Started on 127.0.0.1"));
    EXPECT_FALSE(test::exists("/var/log/ha/ha.daemon.log"));
    stop(daemon);
}

TEST_F(DaemonTest, LargeLogIsRotated) {
    auto daemon = startAndWait({"--log-interval", "0.1", "--rotate-size", "4096"});
    test::appendFile("/tmp/ha/ha.daemon.log", std::string(5000, 'x') + "\n");
    EXPECT_TRUE(test::eventually(10s, [] { return test::exists("/var/log/ha/ha.daemon.log.0.xz"); }));
    EXPECT_FALSE(test::exists("/var/log/ha/ha.daemon.log.1.xz"));
    stop(daemon);
}

TEST_F(DaemonTest, FailedCompressionKeepsTheArchives) {
    test::replaceProgram("/bin/xz", "echo \"$1\" >> /tmp/compressions; exit 1");
    const std::string archive = "/var/log/ha/ha.daemon.log.0.xz";
    test::writeFile(archive, "kept");
    // The snapshots' log may be large enough by itself.
    const auto compressions = [] {
        const std::vector<std::string> files = test::exists("/tmp/compressions")
                                                   ? test::lines(test::readFile("/tmp/compressions"))
                                                   : std::vector<std::string>();
        return std::count(files.begin(), files.end(), "/var/log/ha/ha.daemon.log");
    };
    auto daemon = startAndWait({"--log-interval", "0.1", "--rotate-size", "4096"});
    test::appendFile("/tmp/ha/ha.daemon.log", std::string(5000, 'x') + "\n");
    EXPECT_TRUE(test::eventually(10s, [&] { return !test::exists(archive) && compressions() > 0; }));
    // The next attempt comes when as much again has come; meanwhile the lines go on to be moved.
    const auto attempts = compressions();
    for (const char* line : {"one", "two", "three"}) {
        test::appendFile("/tmp/ha/ha.daemon.log", std::string(line) + "\n");
        EXPECT_TRUE(test::eventually(10s, [&] { return test::bufferText().empty(); }));
    }
    EXPECT_EQ(compressions(), attempts);
    EXPECT_EQ(test::readFile("/var/log/ha/ha.daemon.log.1.xz"), "kept");
    test::appendFile("/tmp/ha/ha.daemon.log", std::string(5000, 'x') + "\n");
    EXPECT_TRUE(test::eventually(10s, [] { return test::exists("/var/log/ha/ha.daemon.log.2.xz"); }));
    stop(daemon);
}

TEST_F(DaemonTest, ExitsWhenTheAddressIsNotLocal) {
    const auto result = test::run(test::daemonArguments("10.9.8.7", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.error,
              "ternhad: interface lo does not have the address 10.9.8.7\n"
              "ternhad: cannot serve the peer on 10.9.8.7: Cannot assign requested address\n");
}

TEST_F(DaemonTest, ExitsWhenThePortIsTaken) {
    const test::UdpSocket other("127.0.0.1", 7499);
    const auto result = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.error, "ternhad: cannot serve the peer on 127.0.0.1: Address already in use\n");
    EXPECT_FALSE(test::exists(test::CONTROL_SOCKET));
}

TEST_F(DaemonTest, ExitsWhenTheControlSocketCannotBeBound) {
    test::writeFile(test::CONTROL_SOCKET, "kept");
    const auto result = test::run(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(test::readFile(test::CONTROL_SOCKET), "kept");
    EXPECT_THAT(result.error, HasSubstr("cannot bind the control socket /run/ternha/control.sock"));
}

TEST_F(DaemonTest, UnknownRequestAbortsIt) {
    auto daemon = startAndWait();
    waitForReplies();
    test::UdpSocket stranger("127.0.0.3", 40000);
    stranger.send("who_are_you", "127.0.0.1", 7499);
    const auto status = daemon.waitFor(10s);
    ASSERT_TRUE(status.has_value());
    EXPECT_TRUE(WIFSIGNALED(*status) && WTERMSIG(*status) == SIGABRT) << *status;
}

// The answers that have come back to a socket so far, each of which must be `expected`.
int repliesAt(test::UdpSocket& socket, const std::string& expected, std::chrono::milliseconds limit) {
    int count = 0;
    while (const auto answer = socket.receive(limit)) {
        EXPECT_EQ(answer->bytes, expected);
        ++count;
    }
    return count;
}

TEST_F(DaemonTest, FloodOfRequestsGetsNoDuplicateOrMisdirectedReply) {
    test::writeFile("/tmp/.ha.hostname.original", "node-a");
    auto daemon = startAndWait();
    waitForReplies();
    const std::map<std::string, std::string> answers = {
        {"is_alive", "alive"},
        {"is_md_resync", "not_resync"},
        {"is_disk_err_handling", R"({"errHandlingDisk":[],"isDiskErrHandling":false})"},
        {"remote_hostname", "node-a"}};
    static constexpr int REQUESTS = 25000;
    std::vector<std::thread> askers;
    std::atomic<int> answered{0};
    for (const auto& [question, expected] : answers) {
        askers.emplace_back([&answered, request = question, reply = expected] {
            test::UdpSocket socket("127.0.0.2");
            int own = 0;
            for (int i = 0; i < REQUESTS; ++i) {
                socket.send(request, "127.0.0.1", 7499);
                if (i % 50 == 0) {
                    own += repliesAt(socket, reply, 0ms);
                }
            }
            own += repliesAt(socket, reply, 1s);
            EXPECT_LE(own, REQUESTS);
            // And now, that all is quiet, one reply for one request.
            socket.send(request, "127.0.0.1", 7499);
            EXPECT_EQ(repliesAt(socket, reply, 1s), 1);
            answered += own;
        });
    }
    for (std::thread& asker : askers) {
        asker.join();
    }
    EXPECT_GT(answered, 0);
    std::printf("%d of %d requests replied to\n", answered.load(), 4 * REQUESTS);
    stop(daemon);
}

TEST_F(DaemonTest, ReportsItsOwnResyncAndDiskErrors) {
    test::writeFile("/proc/drbd", " 0: cs:StandAlone ro:Primary/Unknown\n");
    auto daemon = startAndWait();
    ASSERT_TRUE(test::eventually(10s, [] { return !test::statusAt()["isDRBDConnect"].asBool(); }));
    test::writeFile("/proc/drbd", " 0: cs:SyncSource ro:Primary/Secondary\n");
    test::writeFile("/sys/block/md0/md/sync_action", "resync\n");
    test::writeFile("/sys/class/ata_port/ata3/error_handling", "1\n");
    const std::string device =
        "/sys/devices/pci0000:00/0000:00:1f.2/ata3/host2/target2:0:0/2:0:0:0/block/sdc";
    test::makeDirectories(device);
    std::filesystem::create_symlink(".." + device.substr(4), "/sys/block/sdc");
    const std::size_t before = test::wholeLog("", "ha.daemon.record").size();
    EXPECT_TRUE(test::eventually(10s, [] {
        const Json::Value status = test::statusAt();
        return status["isDRBDConnect"].asBool() && status["isMDResync"].asBool() &&
               status["isDiskErrHandling"].asBool() && status["diskErrorHandlingDisk"][0] == "sdc";
    })) << test::statusAt();
    EXPECT_TRUE(
        test::eventually(10s, [&] { return test::wholeLog("", "ha.daemon.record").size() > before; }));
    test::writeFile("/sys/block/md0/md/sync_action", "idle\n");
    test::writeFile("/sys/class/ata_port/ata3/error_handling", "0\n");
    EXPECT_TRUE(test::eventually(10s, [] {
        const Json::Value status = test::statusAt();
        return !status["isMDResync"].asBool() && !status["isDiskErrHandling"].asBool() &&
               status["diskErrorHandlingDisk"].empty();
    }));
    stop(daemon);
}

TEST_F(DaemonTest, TakesASnapshotAtTheStart) {
    auto daemon = startAndWait({"--snapshot-interval", "3600"});
    EXPECT_TRUE(test::eventually(10s, [] {
        const std::string record = test::wholeLog("", "ha.daemon.record");
        return record.find("\n{\"diskErrorHandlingDisk\":[]") != std::string::npos &&
               record.find("PPID") != std::string::npos && record.find("Mounted on") != std::string::npos &&
               record.find("MemTotal:") != std::string::npos;
    }));
    stop(daemon);
}

TEST_F(DaemonTest, TakesSnapshotsAtTheirInterval) {
    auto daemon = startAndWait({"--snapshot-interval", "0.2"});
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::messages(test::wholeLog()).size() > 0 && test::recordEntries().size() >= 12;
    }));
    stop(daemon);
}

// A peer that answers, from now on, what `answer` says; nothing when that is empty.
void play(test::UdpSocket& peer, const std::function<std::string(const std::string&)>& answer,
          const std::function<bool()>& isOver) {
    EXPECT_TRUE(test::eventually(60s, [&] {
        if (const auto question = peer.receive(10ms)) {
            const std::string text = answer(question->bytes);
            if (!text.empty()) {
                peer.send(text, question->address, question->port);
            }
        }
        return isOver();
    }));
}

TEST_F(DaemonTest, UnreadableDiskReportCountsAsDiskErrors) {
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    play(
        peer,
        [](const std::string& question) {
            return question == "is_disk_err_handling"
                       ? R"({"errHandlingDisk":["sda","sdb","sdc"],"isDiskErrHandling":true)"  // as it is cut
                       : "alive";
        },
        [] { return test::statusAt()["isRemoteDiskErrHandling"].asBool(); });
    stop(daemon);
}

TEST_F(DaemonTest, OneLostReplyKeepsThePeerAlive) {
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    int questions = 0;
    play(
        peer,
        [&](const std::string& question) {
            // Once alive, the peer answers one question of eight.
            return question == "is_alive" && questions++ % 8 != 0 ? "" : "alive";
        },
        [&] { return questions > 24; });
    EXPECT_TRUE(
        test::eventually(10s, [] { return test::wholeLog().find("changed to alive") != std::string::npos; }));
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
    stop(daemon);
}

TEST_F(DaemonTest, SilentPeerIsDead) {
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    play(
        peer, [](const std::string&) { return "alive"; },
        [] { return test::statusAt()["isRemoteAlive"].asBool(); });
    int questions = 0;
    play(
        peer,
        [&questions](const std::string& question) {
            questions += question == "is_alive" ? 1 : 0;
            return "";
        },
        [] { return !test::statusAt()["isRemoteAlive"].asBool(); });
    EXPECT_GE(questions, 10);
    stop(daemon);
}

TEST_F(DaemonTest, MissingReplyKeepsTheLastState) {
    test::UdpSocket peer("127.0.0.2", 7499);
    auto daemon = start();
    const std::string report = R"({"errHandlingDisk":["sda"],"isDiskErrHandling":true})";
    const auto isTroubled = [] {
        const Json::Value status = test::statusAt();
        return status["isRemoteDiskErrHandling"].asBool() && status["isRemoteMDResync"].asBool() &&
               status["diskErrorHandlingDiskRemote"][0] == "sda";
    };
    play(
        peer,
        [&](const std::string& question) {
            return question == "is_disk_err_handling" ? report
                   : question == "is_md_resync"       ? "resync"
                                                      : "alive";
        },
        isTroubled);
    int resyncQuestions = 0;
    play(
        peer,
        [&](const std::string& question) {
            resyncQuestions += question == "is_md_resync" ? 1 : 0;
            return question == "is_alive" ? "alive" : "";
        },
        [&] { return resyncQuestions >= 3; });
    EXPECT_TRUE(isTroubled()) << test::statusAt();
    stop(daemon);
}

}  // namespace
