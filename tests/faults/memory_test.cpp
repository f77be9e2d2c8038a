#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json/value.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <memory>
#include <new>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "checker.h"
#include "control.h"
#include "env_check.h"
#include "env_check/peer.h"
#include "faults/failing_memory.h"
#include "ha_log.h"
#include "socket/local_sockets.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "util.h"

// Each allocation of each operation fails once. The operation returns its failure result or, where
// that is allowed, throws std::bad_alloc; nothing stays open, locked or half done, and the next
// call succeeds.

namespace {

using namespace TERN::HA::Daemon;
using test::BUFFER;
using test::LOG;

constexpr char TRIGGER[] = "/proc/sysrq-trigger";
constexpr char OUT_OF_MEMORY[] = "out of memory";

// An operation, its result as text, and the state that it leaves behind.
struct Operation {
    std::string name;
    std::function<void()> prepare;
    std::function<std::string()> run;
    std::string result;                                                // with enough memory
    std::set<std::string> failures = {};                               // results without
    std::function<std::string()> look = [] { return std::string(); };  // what it leaves behind
    std::string left = "";                                             // with enough memory
    std::set<std::string> leavings = {};                               // the others
    bool throws = false;                                               // when there is none
};

std::string yesNo(bool value) {
    return value ? "yes" : "no";
}

// Final: the class has no virtual destructor.
class Client final : public MonitordSocket {
 public:
    using MonitordSocket::MonitordSocket;
};

class MemoryTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        systemLog = std::make_unique<test::SystemLog>();
    }

    void TearDown() override {
        systemLog.reset();
        test::SandboxTest::TearDown();
    }

    static std::string runWithout(const Operation& operation, int number, bool& hasFailed) {
        const test::FailingMemory memory(number);
        std::string result;
        try {
            result = operation.run();
            hasFailed = memory.hasFailed();
        } catch (const std::bad_alloc&) {
            hasFailed = true;
            return OUT_OF_MEMORY;
        } catch (const Json::RuntimeError&) {
            hasFailed = true;
            return OUT_OF_MEMORY;
        }
        return result;
    }

    static void expectCleanFailure(const Operation& operation) {
        bool hasFailed = true;
        for (int number = 1; hasFailed; ++number) {
            SCOPED_TRACE(operation.name + ", request number " + std::to_string(number));
            operation.prepare();
            const std::string result = runWithout(operation, number, hasFailed);
            if (hasFailed) {
                EXPECT_TRUE((operation.throws && result == OUT_OF_MEMORY) || result == operation.result ||
                            operation.failures.count(result) == 1)
                    << result;
                const std::string left = operation.look();
                EXPECT_TRUE(left == operation.left || operation.leavings.count(left) == 1) << left;
                operation.prepare();
                EXPECT_EQ(operation.run(), operation.result) << "the next call";
            } else {
                EXPECT_GT(number, 1) << "no allocation";
                EXPECT_EQ(result, operation.result);
            }
            EXPECT_EQ(operation.look(), operation.left);
        }
    }

    static void expectCleanFailureOrThrow(Operation operation) {
        operation.throws = true;
        expectCleanFailure(operation);
    }

    std::unique_ptr<test::SystemLog> systemLog;
};

// ---- Local checks ----

TEST_F(MemoryTest, LocalChecksFailCleanly) {
    const std::string disk = "/sys/devices/pci0/ata1/host0/target0:0:0/0:0:0:0/block/sda";
    test::makeDirectories(disk);
    std::filesystem::create_symlink(disk, "/sys/block/sda");
    test::writeFile("/sys/block/md0/md/sync_action", "resync\n");
    test::writeFile("/sys/class/ata_port/ata1/error_handling", "1\n");
    test::writeFile("/tmp/ha/info_hd.remote", R"({"3":{"HD_DEVNAME":"sda"}})");

    expectCleanFailure({"isDRBDConnect",
                        [] { test::writeFile("/proc/drbd", " 0: cs:Connected\n"); },
                        [] { return yesNo(isDRBDConnect()); },
                        "yes",
                        {"no"}});
    expectCleanFailure({"isDRBDConnect without a connection",
                        [] { test::writeFile("/proc/drbd", " 0: cs:StandAlone ro:Primary/Unknown\n"); },
                        [] { return yesNo(isDRBDConnect()); }, "no"});
    expectCleanFailure({"isDRBDConnect without DRBD", [] { test::removeTree("/proc/drbd"); },
                        [] { return yesNo(isDRBDConnect()); }, "no"});
    Operation md{"isMDResync", [] {}, [] { return yesNo(isMDResync()); }, "yes", {"no"}};
    expectCleanFailure(md);
    md.name = "isMDResync without a resync";
    md.prepare = [] {
        test::writeFile("/sys/block/md0/md/sync_action", "no resync, but something longer\n");
    };
    md.result = "no";
    expectCleanFailure(md);
    md.name = "isMDResync without arrays";
    md.prepare = [] { test::removeTree("/sys/block/md0"); };
    md.result = "no";
    expectCleanFailure(md);
    md.name = "isSysfsValue of a file that is not there";
    const std::string missing = "/sys/block/md0/md/sync_action";
    md.run = [&missing] { return yesNo(isSysfsValue(missing, "resync")); };
    expectCleanFailure(md);
    Operation errors{"isDiskErrHandling",
                     [] {},
                     [] {
                         Json::Value disks;
                         const bool isHandling = isDiskErrHandling(disks);
                         return yesNo(isHandling) + " " + std::to_string(disks.size());
                     },
                     "yes 1",
                     {"no 0"}};
    expectCleanFailure(errors);
    errors.name = "isDiskErrHandling without errors";
    errors.prepare = [] { test::writeFile("/sys/class/ata_port/ata1/error_handling", "0\n"); };
    errors.result = "no 0";
    expectCleanFailure(errors);
    expectCleanFailureOrThrow({"devListToHumanReadable",
                               [] {},
                               [] { return Util::devListToHumanReadable({"sda"}).at(0); },
                               "Disk 3",
                               {"sda"}});
}

// ---- Programs ----

TEST_F(MemoryTest, ProgramsFailCleanly) {
    remoteIP("127.0.0.2");
    drbdIF("eth1");
    test::replaceProgram("/bin/ping", "echo 'rtt min/avg/max/mdev = 0.1/2.5/0.3/0.4 ms'; exit 1");
    // Names too long for the small-string optimisation.
    test::replaceProgram("/sbin/ifconfig",
                         "echo 'Iface MTU RX-OK-by-the-interface RX-ERR-by-the-interface'\n"
                         "echo 'eth1 1500 60 40'");
    test::replaceProgram("/bin/df", "echo disks");

    expectCleanFailureOrThrow({"heartbeatLatency",
                               [] {},
                               [] { return std::to_string(heartbeatLatency()); },
                               "2.500000",
                               {"0.000000"}});
    expectCleanFailureOrThrow({"networkNonOkRate",
                               [] {},
                               [] {
                                   InterfaceChecker interface;
                                   float rate = -1;
                                   const bool isKnown = interface.networkNonOkRate(rate);
                                   return yesNo(isKnown) + " " + std::to_string(rate);
                               },
                               "yes 0.400000",
                               {"no -1.000000"}});
    expectCleanFailureOrThrow({"recordDF",
                               [] { test::removeTree("/tmp/ha/ha.daemon.record"); },
                               [] {
                                   recordDF();
                                   return "";
                               },
                               "",
                               {},
                               [] {
                                   const bool isThere = test::exists("/tmp/ha/ha.daemon.record");
                                   return isThere ? test::recordEntries().at(0) : std::string("none");
                               },
                               "\ndisks\n",
                               {"none"}});
}

// ---- Logs ----

TEST_F(MemoryTest, LogsFailCleanly) {
    const auto both = [] {
        return (test::exists(LOG) ? test::readFile(LOG) : "") + "|" + test::bufferText();
    };
    expectCleanFailureOrThrow({"set",
                               [] { test::removeTree(BUFFER); },
                               [] {
                                   daemonLog->set("a line that is longer than a string holds by itself");
                                   return "";
                               },
                               "",
                               {},
                               [] { return test::exists(BUFFER) ? test::daemonLogMessages().at(0) : "none"; },
                               "a line that is longer than a string holds by itself",
                               {"none"}});
    expectCleanFailureOrThrow({"writeLogToDisk",
                               [] {
                                   test::removeTree(LOG);
                                   test::writeFile(BUFFER, "one\ntwo\n");
                               },
                               [] {
                                   daemonLog->writeLogToDisk();
                                   return "";
                               },
                               "",
                               {},
                               both,
                               "one\ntwo\n|",
                               {"|one\ntwo\n"}});
    expectCleanFailureOrThrow(
        {"rotate",
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
         "",
         {},
         // The next rotation picks up a log that is compressed but not renamed.
         [] {
             std::string all;
             for (const auto& entry : std::filesystem::directory_iterator("/var/log/ha")) {
                 const std::string path = entry.path();
                 all += entry.path().filename().string() + ": " +
                        (entry.path().extension() == ".xz"
                             ? test::run({"/bin/xz", "--decompress", "--stdout", path}).output
                             : test::readFile(path));
             }
             return all;
         },
         "ha.daemon.log.0.xz: lines\n",
         {"ha.daemon.log: lines\n", "ha.daemon.log.xz: lines\n"}});
}

// ---- Status ----

TEST_F(MemoryTest, StatusFailsCleanly) {
    static Status status;
    Json::Value disks(Json::arrayValue);
    disks.append("a disk with quite a long name");
    disks.append("another disk with a long name");
    const auto names = [] {
        std::string all;
        for (const Json::Value& name : status.getErrHandlingDisk()) {
            all += name.asString() + ",";
        }
        return all;
    };
    expectCleanFailureOrThrow({"setErrHandlingDisk",
                               [] { status.setErrHandlingDisk(Json::Value()); },
                               [disks] {
                                   status.setErrHandlingDisk(disks);
                                   return "";
                               },
                               "",
                               {},
                               names,
                               "a disk with quite a long name,another disk with a long name,",
                               {""}});
    expectCleanFailureOrThrow({"toJson", [] {},
                               [] { return std::to_string(status.toJson()["diskErrorHandlingDisk"].size()); },
                               "2"});
    expectCleanFailure({"setRemoteAlive", [] { status.setRemoteAlive(false); },
                        [] { return yesNo(status.setRemoteAlive(true) && status.isRemoteAlive()); }, "yes"});
}

// ---- Peer and control requests ----

TEST_F(MemoryTest, HostnameRequestFailsCleanly) {
    remoteIP(test::PEER_ADDRESS);
    test::FakePeer peer("a-host-with-quite-a-long-name");
    std::string hostname;
    Operation name{"GetRemoteHostname",
                   [&hostname] { hostname = std::string(); },
                   [&hostname] {
                       const bool isKnown = GetRemoteHostname()(hostname);
                       return yesNo(isKnown) + ": " + hostname;
                   },
                   "yes: a-host-with-quite-a-long-name",
                   {"no: "},
                   [&hostname] { return hostname; },
                   "a-host-with-quite-a-long-name",
                   {""}};
    expectCleanFailure(name);
}

// Lack of memory must not look like a dead peer.
TEST_F(MemoryTest, LivenessProbeAllocatesNothing) {
    remoteIP(test::PEER_ADDRESS);
    test::FakePeer peer("alive");
    const test::FailingMemory memory(1);
    const bool isAlive = IsRemoteAlive()();
    const bool hasFailed = memory.hasFailed();
    EXPECT_TRUE(isAlive);
    EXPECT_FALSE(hasFailed);
}

// An address too long for the small-string optimisation: allocation failure counts as no reply.
TEST_F(MemoryTest, LongPeerAddressFailsCleanly) {
    remoteIP("no address, and longer than a string holds by itself");
    IsRemoteAlive alive;
    IsRemoteMDResync resync;
    for (EnvCheck* const check : std::initializer_list<EnvCheck*>{&alive, &resync}) {
        const test::FailingMemory memory(1);
        const bool isTrue = (*check)();
        const bool hasFailed = memory.hasFailed();
        EXPECT_FALSE(isTrue);
        EXPECT_TRUE(hasFailed);
    }
}

TEST_F(MemoryTest, DisksRequestFailsCleanly) {
    remoteIP(test::PEER_ADDRESS);
    for (const bool isHandling : {true, false}) {
        const std::string flag = isHandling ? "true" : "false";
        test::FakePeer peer(R"({"errHandlingDisk":["sda","sdb"],"isDiskErrHandling":)" + flag + "}");
        Json::Value disks;
        expectCleanFailure({"IsRemoteDiskErrHandling " + flag,
                            [&disks] { disks = Json::Value(Json::arrayValue); },
                            [&disks] { return yesNo(IsRemoteDiskErrHandling()(disks)); },
                            yesNo(isHandling),
                            {"no"},
                            [&disks] { return std::to_string(disks.size()); },
                            "2",
                            {"0"}});
    }
}

TEST_F(MemoryTest, RebootRequestFailsCleanly) {
    remoteIP(test::PEER_ADDRESS);
    test::FakePeer peer("");
    static Status status;
    expectCleanFailure({"RebootRemote",
                        [] { status.delRemoteNodeState(NodeRebooting); },
                        [] { return yesNo(RebootRemote()(status)); },
                        "yes",
                        {},
                        [] { return std::to_string(status.getRemoteNodeState()); },
                        std::to_string(NodeRebooting)});
}

// The server socket stays open until the process ends: create it before the base counts
// descriptors.
class PeerServerMemoryTest : public MemoryTest {
 protected:
    void SetUp() override {
        localIP(test::PEER_ADDRESS);
        std::thread firstPass([] {
            Status status;
            SocketServer()(status);
        });
        test::UdpSocket sender;
        do {
            sender.send("is_alive", test::PEER_ADDRESS, test::PEER_PORT);
        } while (!sender.receive(std::chrono::milliseconds(50)));
        firstPass.join();
        MemoryTest::SetUp();
    }
};

TEST_F(PeerServerMemoryTest, ServerPassFailsCleanly) {
    Status status;
    Json::Value disks(Json::arrayValue);
    disks.append("sda");
    status.setErrHandlingDisk(disks);
    std::optional<test::UdpSocket> sender;
    SocketServer server;
    expectCleanFailure({"a pass of the server",
                        [&sender] {
                            sender.emplace();
                            sender->send("is_disk_err_handling", test::PEER_ADDRESS, test::PEER_PORT);
                        },
                        [&server, &status] { return yesNo(server(status)); },
                        "yes",
                        {},
                        [&sender] {
                            std::string all;
                            for (const std::string& reply : test::arrived(*sender)) {
                                all += reply;
                            }
                            return all;
                        },
                        R"({"errHandlingDisk":["sda"],"isDiskErrHandling":false})",
                        {""}});
}

TEST_F(MemoryTest, RepliesOfTheChecksFailCleanly) {
    test::writeFile("/tmp/.ha.hostname.original", "a-host-with-quite-a-long-name\n");
    Status status;
    expectCleanFailure({"IsRemoteDiskErrHandling",
                        [] {},
                        [&status] { return IsRemoteDiskErrHandling().handle(status); },
                        R"({"errHandlingDisk":[],"isDiskErrHandling":false})",
                        {""}});
    expectCleanFailure({"GetRemoteHostname",
                        [] {},
                        [&status] { return GetRemoteHostname().handle(status); },
                        "a-host-with-quite-a-long-name\n",
                        {""}});
}

TEST_F(MemoryTest, ControlHandlerFailsCleanly) {
    Status status;
    MonitordSocket server(test::LOCAL_SOCKET, 0);
    server.setStatus(&status);
    for (const auto& [action, result] :
         {std::pair("I", "yes 10"), std::pair("r", "yes 1"),
          std::pair("an unknown one, longer than a string holds by itself", "no 0")}) {
        Json::Value request;
        request["act"] = action;
        Json::Value reply;
        expectCleanFailure({action,
                            [&reply] { reply = Json::Value(); },
                            [&server, &request, &reply] {
                                const bool hasReply = server.serverHandle(request, reply);
                                return yesNo(hasReply) + " " + std::to_string(reply.size());
                            },
                            result,
                            {"no 0"}});
    }
}

TEST_F(MemoryTest, ControlServerFailsCleanly) {
    Status status;
    MonitordSocket server(test::LOCAL_SOCKET, 0);
    server.setStatus(&status);
    ASSERT_TRUE(server.serverBind());
    std::optional<test::RawClient> client;
    Operation query{"a query",
                    [&client] {
                        client.emplace();
                        client->send(R"({"act":"I"})");
                    },
                    [&server] { return yesNo(server.serverListen()); },
                    "yes",
                    {"no"},
                    [&client] {
                        const std::string reply = client->receiveAll();
                        const bool isWhole = !reply.empty() && reply.front() == '{' && reply.back() == '}';
                        return reply.empty() ? "closed" : isWhole ? "whole" : reply;
                    },
                    "whole",
                    {"closed"}};
    expectCleanFailure(query);
}

TEST_F(MemoryTest, ControlClientFailsCleanly) {
    test::HandlerSocket server([](const Json::Value&, Json::Value& reply) {
        reply = "a reply that is longer than a string holds by itself";
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    std::optional<test::HandlerSocket> client;
    const Json::Value request("request");
    Json::Value reply;
    std::size_t lines = 0;
    expectCleanFailure(
        {"clientSend",
         [&] {
             client.emplace(test::HandlerSocket::Handler(), test::LOCAL_SOCKET, 5);
             reply = Json::Value();
             lines = systemLog->texts().size();
         },
         [&client, &request, &reply] {
             const bool hasReply = client->clientSend(request, reply);
             return yesNo(hasReply) + (reply.isNull() ? " null" : " reply");
         },
         "yes reply",
         {"no null"},
         [&] { return yesNo(client->hasError()) + " " + std::to_string(systemLog->texts().size() - lines); },
         "no 0",
         {"yes 1"}});
}

TEST_F(MemoryTest, ControlClientRebootQueryFailsCleanly) {
    test::HandlerSocket server([](const Json::Value&, Json::Value& reply) {
        reply["is_froce_reboot_remote"] = true;
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    std::optional<Client> client;
    expectCleanFailure({"isRebootRemote",
                        [&client] { client.emplace(test::LOCAL_SOCKET, 5); },
                        [&client] { return yesNo(client->isRebootRemote()); },
                        "yes",
                        {"no"}});
}

TEST_F(MemoryTest, ControlClientWithoutAServerFailsCleanly) {
    std::optional<Client> client;
    const auto prepare = [&client] { client.emplace("/tmp/nowhere", 5); };
    Json::Value status;
    expectCleanFailure({"rebootRemote", prepare, [&client] { return yesNo(client->rebootRemote()); }, "no"});
    expectCleanFailure(
        {"getServerData", prepare, [&] { return yesNo(client->getServerData(status)); }, "no"});
}

// ---- The reboot ----

// A node out of memory must still reboot.
TEST_F(MemoryTest, RebootHappensWithoutMemory) {
    test::writeFile(TRIGGER, "");
    Status status;
    expectCleanFailure({"the reboot handler",
                        [] {
                            test::writeFile(BUFFER, "one\ntwo\n");
                            test::writeFile("/tmp/ha/ha.daemon.record", "three\n");
                            test::writeFile(TRIGGER, "");
                        },
                        [&status] { return RebootRemote().handle(status); },
                        "",
                        {},
                        [] { return test::readFile(TRIGGER); },
                        "b"});
}

}  // namespace
