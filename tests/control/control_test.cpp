#include "control.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <optional>
#include <ostream>

#include "env_check.h"
#include "socket/local_sockets.h"
#include "support/case_name.h"
#include "support/json.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;
using test::parsed;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

// Final: the class has no virtual destructor.
class Server final : public MonitordSocket {
 public:
    using MonitordSocket::MonitordSocket;
};

class ControlTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        server.emplace(test::LOCAL_SOCKET, 0);
        server->setStatus(&status);
        ASSERT_TRUE(server->serverBind());
    }

    void TearDown() override {
        server.reset();
        test::SandboxTest::TearDown();
    }

    // Send a request, serve it and return the raw reply.
    std::string send(const std::string& request) {
        const test::RawClient client;
        if (request.empty()) {
            client.finish();
        } else {
            client.send(request);
        }
        server->serverListen();
        return client.receiveAll();
    }

    Status status;
    std::optional<Server> server;
};

TEST_F(ControlTest, ReturnsTheStatus) {
    status.isMDResync = true;
    status.setErrHandlingDisk(parsed(R"(["sda"])"));
    const std::string record =
        R"({"diskErrorHandlingDisk":["sda"],"diskErrorHandlingDiskRemote":[],"heartbeatLatency":0.0,)"
        R"("heartbeatPacketFailRate":0.0,"isDRBDConnect":true,"isDiskErrHandling":false,"isMDResync":true,)"
        R"("isRemoteAlive":false,"isRemoteDiskErrHandling":false,"isRemoteMDResync":false})";
    EXPECT_EQ(send(R"({"act":"I"})"), record);
    EXPECT_EQ(send(R"({"act":"Info"})"), record);  // only the first character counts
    EXPECT_EQ(send(R"({"act":"I","more":[1,2,3]})"), record);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(ControlTest, ReturnsWhetherThePeerIsRebooting) {
    EXPECT_EQ(send(R"({"act":"r"})"), R"({"is_froce_reboot_remote":false})");
    status.addRemoteNodeState(NodeRebootPending);
    EXPECT_EQ(send(R"({"act":"r"})"), R"({"is_froce_reboot_remote":true})");
    status.delRemoteNodeState(NodeRebootPending);
    status.addRemoteNodeState(NodeRebooting);
    EXPECT_EQ(send(R"({"act":"rubbish"})"), R"({"is_froce_reboot_remote":true})");
}

TEST_F(ControlTest, RebootsThePeerAndRepliesNull) {
    remoteIP("127.0.0.2");
    test::UdpSocket peer("127.0.0.2", 7499);
    std::thread serving([this] { server->serverListen(); });
    const test::RawClient client;
    client.send(R"({"act":"R"})");
    const auto request = peer.receive(10s);
    ASSERT_TRUE(request.has_value());
    EXPECT_EQ(request->bytes, "reboot_remote");
    peer.send("", request->address, request->port);
    EXPECT_EQ(client.receiveAll(), "null");
    serving.join();
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("checker.cpp", "Remote offline")));
}

TEST_F(ControlTest, BlocksOtherClientsUntilThePeerIsDead) {
    remoteIP("127.0.0.2");
    status.setRemoteAlive(true);
    test::UdpSocket peer("127.0.0.2", 7499);
    const test::ServingThread serving(*server);
    const test::RawClient reboot;
    reboot.send(R"({"act":"R"})");
    const auto request = peer.receive(10s);
    ASSERT_TRUE(request.has_value());
    std::atomic<bool> isServed{false};
    std::thread next([&] {
        EXPECT_EQ(test::exchange(R"({"act":"r"})"), R"({"is_froce_reboot_remote":true})");
        isServed = true;
    });
    peer.send("", request->address, request->port);
    ASSERT_TRUE(test::eventually(10s, [this] { return status.isRemoteRebooting(); }));
    EXPECT_FALSE(test::eventually(1500ms, [&] { return isServed.load(); }));
    status.setRemoteAlive(false);
    EXPECT_EQ(reboot.receiveAll(), "null");
    next.join();
}

struct RefusedRequest {
    const char* name;
    std::string request;
    std::string line;
};

void PrintTo(const RefusedRequest& request, std::ostream* stream) {
    *stream << request.name;
}

const std::string LONGEST_REQUEST = R"({"a":")" + std::string(2087, 'y') + R"("})";

class RefusedRequestTest : public ControlTest, public ::testing::WithParamInterface<RefusedRequest> {};

TEST_P(RefusedRequestTest, IsLoggedWithoutAReply) {
    EXPECT_EQ(send(GetParam().request), "");
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("control.cpp", GetParam().line)));
    EXPECT_NE(send(R"({"act":"I"})"), "");
}

INSTANTIATE_TEST_SUITE_P(
    Requests, RefusedRequestTest,
    ::testing::Values(
        RefusedRequest{"UnknownLetter", R"({"act":"x"})", "Unknown action x"},
        RefusedRequest{"UnknownWords", R"({"act":"x and more"})", "Unknown action x and more"},
        RefusedRequest{"OtherCase", R"({"act":"i"})", "Unknown action i"},
        RefusedRequest{"EmptyString", R"({"act":""})", "Unknown action "},
        RefusedRequest{"ZeroFirst", R"({"act":"\u0000I"})", std::string("Unknown action \0I", 17)},
        RefusedRequest{"Number", R"({"act":5})", "Unknown action 5"},
        RefusedRequest{"Bool", R"({"act":true})", "Unknown action true"},
        RefusedRequest{"Real", R"({"act":1.5})", "Unknown action 1.5"},
        RefusedRequest{"Null", R"({"act":null})", "Unknown action "},
        RefusedRequest{"Array", R"({"act":["I"]})", "Unknown action "},
        RefusedRequest{"Object", R"({"act":{"I":"I"}})", "Unknown action "},
        RefusedRequest{"NoAct", R"({ "Act" : "I", "a": [1, 2] })",
                       R"(Failed get action from content: {"Act":"I","a":[1,2]})"},
        RefusedRequest{"EmptyObject", "{}", "Failed get action from content: {}"},
        RefusedRequest{"LongestObject", LONGEST_REQUEST,
                       "Failed get action from content: " + LONGEST_REQUEST},
        RefusedRequest{"NoObjectButAnArray", R"(["act"])", R"(Failed get action from content: ["act"])"},
        RefusedRequest{"NoObjectButAString", R"("I")", R"(Failed get action from content: "I")"},
        RefusedRequest{"NoObjectButANumber", "7", "Failed get action from content: 7"},
        RefusedRequest{"NoObjectButNull", "null", "Failed get action from content: null"}),
    test::CaseName());

// Only the socket class, which fails to parse them, logs these.
TEST_F(ControlTest, InvalidJsonIsNotLoggedAndTheNextClientIsServed) {
    for (const std::string request : {"", "I", "{\"act\":\"I\"", "{act:\"I\"}"}) {
        EXPECT_EQ(send(request), "") << request;
    }
    EXPECT_EQ(send("{\"act\":" + std::string(2000, '[')), "");
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
    EXPECT_EQ(send(R"({"act":"r"})"), R"({"is_froce_reboot_remote":false})");
}

TEST_F(ControlTest, HandlerReturnsWhetherThereIsAReply) {
    Json::Value reply;
    EXPECT_TRUE(server->serverHandle(parsed(R"({"act":"I"})"), reply));
    EXPECT_EQ(reply, status.toJson());
    reply = Json::Value();
    EXPECT_FALSE(server->serverHandle(parsed(R"({"act":"?"})"), reply));
    EXPECT_TRUE(reply.isNull());
}

// ---- Client ----

TEST_F(ControlTest, ClientReadsTheStatus) {
    const test::ServingThread serving(*server);
    status.setRemoteAlive(true);
    Json::Value record;
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 5).getServerData(record));
    EXPECT_EQ(record, status.toJson());
}

TEST_F(ControlTest, ClientReadsWhetherThePeerIsRebooting) {
    const test::ServingThread serving(*server);
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 5).isRebootRemote());
    status.addRemoteNodeState(NodeRebooting);
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 5).isRebootRemote());
}

TEST_F(ControlTest, ClientRequestsAReboot) {
    remoteIP("127.0.0.2");  // no peer replies
    const test::ServingThread serving(*server);
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 40).rebootRemote());
    EXPECT_TRUE(status.isRemoteRebooting());
}

TEST(ControlClientTest, RequestsAreCompact) {
    const test::SilentServer server;
    Json::Value record;
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).getServerData(record));
    EXPECT_EQ(server.received(), R"({"act":"I"})");
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).isRebootRemote());
    EXPECT_EQ(server.received(), R"({"act":"r"})");
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).rebootRemote());
    EXPECT_EQ(server.received(), R"({"act":"R"})");
}

TEST(ControlClientTest, EverythingIsFalseWithoutAServer) {
    Json::Value record("unchanged");
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).getServerData(record));
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).rebootRemote());
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).isRebootRemote());
    EXPECT_EQ(record, "unchanged");
}

struct UnexpectedReply {
    const char* name;
    const char* text;
};

void PrintTo(const UnexpectedReply& reply, std::ostream* stream) {
    *stream << reply.name;
}

class UnexpectedReplyTest : public test::SandboxTest,
                            public ::testing::WithParamInterface<UnexpectedReply> {};

TEST_P(UnexpectedReplyTest, MeansNotRebooting) {
    test::SystemLog systemLog;
    test::HandlerSocket server([](const Json::Value& request, Json::Value& reply) {
        EXPECT_EQ(request, parsed(R"({"act":"r"})"));
        reply = parsed(GetParam().text);
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    MonitordSocket client(test::LOCAL_SOCKET, 5);
    EXPECT_FALSE(client.isRebootRemote());
    EXPECT_FALSE(client.hasError());
    EXPECT_THAT(systemLog.texts(), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(Replies, UnexpectedReplyTest,
                         ::testing::Values(UnexpectedReply{"EmptyObject", "{}"},
                                           UnexpectedReply{"AnotherMember",
                                                           R"({"is_force_reboot_remote":true})"},
                                           UnexpectedReply{"Null", "null"}, UnexpectedReply{"Bool", "true"},
                                           UnexpectedReply{"Array", "[true]"}, UnexpectedReply{"Number", "7"},
                                           UnexpectedReply{"AString", R"({"is_froce_reboot_remote":"true"})"},
                                           UnexpectedReply{"AnArray", R"({"is_froce_reboot_remote":[true]})"},
                                           UnexpectedReply{"ANull", R"({"is_froce_reboot_remote":null})"}),
                         test::CaseName());

}  // namespace
