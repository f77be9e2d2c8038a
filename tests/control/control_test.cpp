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

// Final, because the class has no virtual destructor.
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

    // One exchange of bytes.
    std::string ask(const std::string& request) {
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

TEST_F(ControlTest, GivesTheStatus) {
    status.isMDResync = true;
    status.setErrHandlingDisk(parsed(R"(["sda"])"));
    const std::string record =
        R"({"diskErrorHandlingDisk":["sda"],"diskErrorHandlingDiskRemote":[],"heartbeatLatency":0.0,)"
        R"("heartbeatPacketFailRate":0.0,"isDRBDConnect":true,"isDiskErrHandling":false,"isMDResync":true,)"
        R"("isRemoteAlive":false,"isRemoteDiskErrHandling":false,"isRemoteMDResync":false})";
    EXPECT_EQ(ask(R"({"act":"I"})"), record);
    EXPECT_EQ(ask(R"({"act":"Info"})"), record);  // only the first character counts
    EXPECT_EQ(ask(R"({"act":"I","more":[1,2,3]})"), record);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(ControlTest, TellsWhetherThePeerIsBeingRebooted) {
    EXPECT_EQ(ask(R"({"act":"r"})"), R"({"is_froce_reboot_remote":false})");
    status.addRemoteNodeState(NodeRebootPending);
    EXPECT_EQ(ask(R"({"act":"r"})"), R"({"is_froce_reboot_remote":true})");
    status.delRemoteNodeState(NodeRebootPending);
    status.addRemoteNodeState(NodeRebooting);
    EXPECT_EQ(ask(R"({"act":"rubbish"})"), R"({"is_froce_reboot_remote":true})");
}

TEST_F(ControlTest, RebootsThePeerAndAnswersNull) {
    remoteIP("127.0.0.2");
    test::UdpSocket peer("127.0.0.2", 7499);
    std::thread serving([this] { server->serverListen(); });
    const test::RawClient client;
    client.send(R"({"act":"R"})");
    const auto question = peer.receive(10s);
    ASSERT_TRUE(question.has_value());
    EXPECT_EQ(question->bytes, "reboot_remote");
    peer.send("", question->address, question->port);
    EXPECT_EQ(client.receiveAll(), "null");
    serving.join();
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("checker.cpp", "Remote offline")));
}

TEST_F(ControlTest, ServesNobodyElseUntilThePeerIsDown) {
    remoteIP("127.0.0.2");
    status.setRemoteAlive(true);
    test::UdpSocket peer("127.0.0.2", 7499);
    const test::ServingThread serving(*server);
    const test::RawClient reboot;
    reboot.send(R"({"act":"R"})");
    const auto question = peer.receive(10s);
    ASSERT_TRUE(question.has_value());
    std::atomic<bool> isServed{false};
    std::thread next([&] {
        EXPECT_EQ(test::exchange(R"({"act":"r"})"), R"({"is_froce_reboot_remote":true})");
        isServed = true;
    });
    peer.send("", question->address, question->port);
    ASSERT_TRUE(test::eventually(10s, [this] { return status.isRemoteRebooting(); }));
    EXPECT_FALSE(test::eventually(1500ms, [&] { return isServed.load(); }));
    status.setRemoteAlive(false);
    EXPECT_EQ(reboot.receiveAll(), "null");
    next.join();
}

struct Refusal {
    const char* name;
    std::string request;
    std::string line;
};

void PrintTo(const Refusal& refusal, std::ostream* stream) {
    *stream << refusal.name;
}

const std::string LONGEST_REQUEST = R"({"a":")" + std::string(2087, 'y') + R"("})";

class RefusalTest : public ControlTest, public ::testing::WithParamInterface<Refusal> {};

TEST_P(RefusalTest, IsLoggedAndNotAnswered) {
    EXPECT_EQ(ask(GetParam().request), "");
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("control.cpp", GetParam().line)));
    EXPECT_NE(ask(R"({"act":"I"})"), "");
}

INSTANTIATE_TEST_SUITE_P(
    Requests, RefusalTest,
    ::testing::Values(
        Refusal{"UnknownLetter", R"({"act":"x"})", "Unknown action x"},
        Refusal{"UnknownWords", R"({"act":"x and more"})", "Unknown action x and more"},
        Refusal{"OtherCase", R"({"act":"i"})", "Unknown action i"},
        Refusal{"EmptyString", R"({"act":""})", "Unknown action "},
        Refusal{"ZeroFirst", R"({"act":"\u0000I"})", std::string("Unknown action \0I", 17)},
        Refusal{"Number", R"({"act":5})", "Unknown action 5"},
        Refusal{"Bool", R"({"act":true})", "Unknown action true"},
        Refusal{"Real", R"({"act":1.5})", "Unknown action 1.5"},
        Refusal{"Null", R"({"act":null})", "Unknown action "},
        Refusal{"Array", R"({"act":["I"]})", "Unknown action "},
        Refusal{"Object", R"({"act":{"I":"I"}})", "Unknown action "},
        Refusal{"NoAct", R"({ "Act" : "I", "a": [1, 2] })",
                R"(Failed get action from content: {"Act":"I","a":[1,2]})"},
        Refusal{"EmptyObject", "{}", "Failed get action from content: {}"},
        Refusal{"LongestObject", LONGEST_REQUEST, "Failed get action from content: " + LONGEST_REQUEST},
        Refusal{"NoObjectButAnArray", R"(["act"])", R"(Failed get action from content: ["act"])"},
        Refusal{"NoObjectButAString", R"("I")", R"(Failed get action from content: "I")"},
        Refusal{"NoObjectButANumber", "7", "Failed get action from content: 7"},
        Refusal{"NoObjectButNull", "null", "Failed get action from content: null"}),
    test::CaseName());

// Texts that are no requests at all are none of the handler's business, and cost it nothing.
TEST_F(ControlTest, WhatIsNoJsonLeavesNoLineAndTheNextClientIsServed) {
    for (const std::string request : {"", "I", "{\"act\":\"I\"", "{act:\"I\"}"}) {
        EXPECT_EQ(ask(request), "") << request;
    }
    EXPECT_EQ(ask("{\"act\":" + std::string(2000, '[')), "");
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
    EXPECT_EQ(ask(R"({"act":"r"})"), R"({"is_froce_reboot_remote":false})");
}

TEST_F(ControlTest, TheHandlersResultSaysWhetherThereIsAReply) {
    Json::Value reply;
    EXPECT_TRUE(server->serverHandle(parsed(R"({"act":"I"})"), reply));
    EXPECT_EQ(reply, status.toJson());
    reply = Json::Value();
    EXPECT_FALSE(server->serverHandle(parsed(R"({"act":"?"})"), reply));
    EXPECT_TRUE(reply.isNull());
}

// ---- The client's side ----

TEST_F(ControlTest, AClientReadsTheStatus) {
    const test::ServingThread serving(*server);
    status.setRemoteAlive(true);
    Json::Value record;
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 5).getServerData(record));
    EXPECT_EQ(record, status.toJson());
}

TEST_F(ControlTest, AClientAsksWhetherThePeerIsBeingRebooted) {
    const test::ServingThread serving(*server);
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 5).isRebootRemote());
    status.addRemoteNodeState(NodeRebooting);
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 5).isRebootRemote());
}

TEST_F(ControlTest, AClientOrdersAReboot) {
    remoteIP("127.0.0.2");  // nobody answers
    const test::ServingThread serving(*server);
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 40).rebootRemote());
    EXPECT_TRUE(status.isRemoteRebooting());
}

TEST(ControlClientTest, AsksInCompactTexts) {
    const test::SilentServer server;
    Json::Value record;
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).getServerData(record));
    EXPECT_EQ(server.received(), R"({"act":"I"})");
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).isRebootRemote());
    EXPECT_EQ(server.received(), R"({"act":"r"})");
    EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 1).rebootRemote());
    EXPECT_EQ(server.received(), R"({"act":"R"})");
}

TEST(ControlClientTest, WithoutAServerEverythingIsFalse) {
    Json::Value record("as it was");
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).getServerData(record));
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).rebootRemote());
    EXPECT_FALSE(MonitordSocket("/tmp/nowhere", 1).isRebootRemote());
    EXPECT_EQ(record, "as it was");
}

struct OddReply {
    const char* name;
    const char* text;
};

void PrintTo(const OddReply& reply, std::ostream* stream) {
    *stream << reply.name;
}

class OddReplyTest : public test::SandboxTest, public ::testing::WithParamInterface<OddReply> {};

TEST_P(OddReplyTest, IsNoRebootAndNoFailure) {
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

INSTANTIATE_TEST_SUITE_P(Replies, OddReplyTest,
                         ::testing::Values(OddReply{"EmptyObject", "{}"},
                                           OddReply{"AnotherMember", R"({"is_force_reboot_remote":true})"},
                                           OddReply{"Null", "null"}, OddReply{"Bool", "true"},
                                           OddReply{"Array", "[true]"}, OddReply{"Number", "7"},
                                           OddReply{"AString", R"({"is_froce_reboot_remote":"true"})"},
                                           OddReply{"AnArray", R"({"is_froce_reboot_remote":[true]})"},
                                           OddReply{"ANull", R"({"is_froce_reboot_remote":null})"}),
                         test::CaseName());

}  // namespace
