#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <optional>
#include <thread>

#include "faults/failing_call.h"
#include "socket/local_sockets.h"
#include "socket/socket_test.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using test::HandlerSocket;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class ClientSocketTest : public test::SocketTest {
 protected:
    Json::Value request{"request"};
    Json::Value reply{"unchanged"};
};

TEST_F(ClientSocketTest, SendsOneRequestAndReceivesItsReply) {
    HandlerSocket server([](const Json::Value& received, Json::Value& result) {
        result["got"] = received;
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    HandlerSocket client({}, test::LOCAL_SOCKET, 5);
    EXPECT_TRUE(client.clientSend(request, reply));
    EXPECT_EQ(reply["got"], "request");
    EXPECT_FALSE(client.hasError());
    EXPECT_THAT(systemLog(), IsEmpty());
}

TEST_F(ClientSocketTest, SecondRequestFailsForGood) {
    HandlerSocket server([](const Json::Value&, Json::Value&) { return true; });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    HandlerSocket client;
    EXPECT_TRUE(client.clientSend(request, reply));
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_THAT(
        systemLog(),
        ElementsAre(test::LogLine("socket.cpp",
                                  "Failed to connect socket /tmp/control.sock: Transport endpoint is "
                                  "already connected"),
                    test::LogLine("socket.cpp",
                                  "Failed to connect socket server: Transport endpoint is already connected"),
                    test::LogLine("socket.cpp", "Failed to send content: has error")));
}

TEST_F(ClientSocketTest, ConnectFailureLogsTwoLines) {
    HandlerSocket client;
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_EQ(reply, "unchanged");
    EXPECT_THAT(systemLog(), ElementsAre(test::LogLine("socket.cpp",
                                                       "Failed to connect socket /tmp/control.sock: No "
                                                       "such file or directory"),
                                         test::LogLine("socket.cpp",
                                                       "Failed to connect socket server: No such file "
                                                       "or directory")));
}

TEST_F(ClientSocketTest, TimeoutOptionFailureLogsTwoLines) {
    HandlerSocket client({}, test::LOCAL_SOCKET, 5);
    const test::FailingCall failing("setsockopt", EDOM);
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_THAT(systemLog(), ElementsAre(test::LogLine("socket.cpp", "Failed to set socket timeout"),
                                         test::LogLine("socket.cpp",
                                                       "Failed to connect socket server: Numerical "
                                                       "argument out of domain")));
}

TEST_F(ClientSocketTest, TimesOut) {
    const test::SilentServer server;
    HandlerSocket client({}, test::LOCAL_SOCKET, 5);
    const test::Stopwatch stopwatch;
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_GE(stopwatch.elapsed(), 5s);
    EXPECT_EQ(test::receiveTimeout(), 5s);
    EXPECT_TRUE(client.hasError());
    EXPECT_EQ(reply, "unchanged");
    EXPECT_THAT(systemLog(), ElementsAre(test::LogLine("socket.cpp",
                                                       "Failed to recv , Resource temporarily unavailable")));
}

TEST_F(ClientSocketTest, RequestIsCompactAndUnterminated) {
    request = Json::Value(Json::objectValue);
    request["b"].append(1);
    request["a"] = true;
    const test::SilentServer server;
    HandlerSocket client({}, test::LOCAL_SOCKET, 1);
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_EQ(server.received(), R"({"a":true,"b":[1]})");
}

class NoTimeoutTest : public ClientSocketTest, public ::testing::WithParamInterface<unsigned int> {};

TEST_P(NoTimeoutTest, SetsNoSocketOption) {
    test::HandlerSocket client({}, "/tmp/nowhere", GetParam());
    const test::FailingCall failing("setsockopt", EDOM);  // no timeout is set at all
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_THAT(systemLog(), ElementsAre(HasSubstr(" Failed to connect socket /tmp/nowhere: "),
                                         HasSubstr(" Failed to connect socket server: ")));
}

INSTANTIATE_TEST_SUITE_P(Timeouts, NoTimeoutTest, ::testing::Values(0U, 2147483648U, 4294967295U));

TEST_F(ClientSocketTest, RefusedRequestFailsToParse) {
    HandlerSocket server([](const Json::Value&, Json::Value&) { return false; });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    HandlerSocket client;
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_EQ(reply, "unchanged");
    EXPECT_THAT(systemLog(), ::testing::UnorderedElementsAre(
                                 test::LogLine("socket.cpp", "Failed to handle input data: \"request\""),
                                 HasSubstr(" Failed to parse , ")));
}

TEST_F(ClientSocketTest, ReplyOf2095BytesIsReceivedWhole) {
    HandlerSocket server([](const Json::Value&, Json::Value& result) {
        result = std::string(2093, 'y');
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    HandlerSocket client;
    EXPECT_TRUE(client.clientSend(request, reply));
    EXPECT_EQ(reply, std::string(2093, 'y'));
}

TEST_F(ClientSocketTest, LongerReplyIsTruncatedAndFailsToParse) {
    HandlerSocket server([](const Json::Value&, Json::Value& result) {
        result = std::string(2094, 'y');
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    HandlerSocket client;
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_EQ(reply, "unchanged");
    EXPECT_THAT(systemLog(), ElementsAre(HasSubstr(" Failed to parse \"" + std::string(2094, 'y') + ", ")));
}

TEST_F(ClientSocketTest, ServerClosingBeforeTheRequestRaisesNoSigpipe) {
    std::optional<test::SilentServer> server(std::in_place);
    const test::ConnectHook leave([&server] { server.reset(); });
    HandlerSocket client({}, test::LOCAL_SOCKET, 5);
    EXPECT_FALSE(client.clientSend(request, reply));
    EXPECT_TRUE(client.hasError());
    EXPECT_EQ(reply, "unchanged");
    EXPECT_THAT(systemLog(), ElementsAre(test::LogLine("socket.cpp", "Failed to send content: \"request\"")));
}

TEST_F(ClientSocketTest, ServerClosingBeforeItsReplyIsLogged) {
    const test::SilentServer server;
    std::thread leaving([&server] { server.dropRequest(); });
    HandlerSocket client({}, test::LOCAL_SOCKET, 60);
    EXPECT_FALSE(client.clientSend(request, reply));
    leaving.join();
    EXPECT_TRUE(client.hasError());
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to recv , Connection reset by peer")));
}

}  // namespace
