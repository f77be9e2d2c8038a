#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <initializer_list>
#include <memory>
#include <optional>
#include <ostream>
#include <system_error>
#include <thread>
#include <vector>

#include "faults/failing_call.h"
#include "socket/local_sockets.h"
#include "socket/socket_test.h"
#include "support/case_name.h"
#include "support/files.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using test::HandlerSocket;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

bool echo(const Json::Value& request, Json::Value& reply) {
    reply["got"] = request;
    return true;
}

class ServerSocketTest : public test::SocketTest {
 protected:
    static void expectEchoes(std::initializer_list<std::string> requests) {
        HandlerSocket server(echo);
        ASSERT_TRUE(server.serverBind());
        for (const std::string& request : requests) {
            const test::RawClient client;
            client.send(request);
            EXPECT_TRUE(server.serverListen());
            EXPECT_EQ(client.receiveAll(), "{\"got\":" + request + "}");
        }
    }
};

TEST_F(ServerSocketTest, SendsACompactReplyAndCloses) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{ \"b\" : [1, 2],\n\"a\": null /* comments may be there */ }");
    EXPECT_EQ(test::backlog(), 100);
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), R"({"got":{"a":null,"b":[1,2]}})");
    EXPECT_FALSE(server.hasError());
    EXPECT_THAT(systemLog(), IsEmpty());
}

TEST_F(ServerSocketTest, RequestOf2095BytesIsReceivedWhole) {
    HandlerSocket server([](const Json::Value& request, Json::Value& reply) {
        reply = Json::Value::UInt64{request["x"].asString().size()};
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send(R"({"x":")" + std::string(2095 - 8, 'y') + R"("})");
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), "2087");
}

TEST_F(ServerSocketTest, LongerRequestIsTruncatedAndFailsToParse) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const std::string request = R"({"x":")" + std::string(2096 - 8, 'y') + R"("})";
    const test::RawClient client;
    client.send(request);
    EXPECT_FALSE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), "");
    EXPECT_THAT(systemLog(),
                ElementsAre(AllOf(StartsWith("socket.cpp:"),
                                  HasSubstr(" Failed to parse " + request.substr(0, 2095) + ", "))));
}

TEST_F(ServerSocketTest, RequestIsReadWithASingleCall) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{\"act\":");
    EXPECT_FALSE(server.serverListen());
    client.send("\"I\"}");
    EXPECT_EQ(client.receiveAll(), "");
    EXPECT_THAT(systemLog(), ElementsAre(HasSubstr(" Failed to parse {\"act\":, ")));
}

TEST_F(ServerSocketTest, RefusedRequestGetsNoReply) {
    HandlerSocket server([](const Json::Value&, Json::Value& reply) {
        reply = "not to be sent";
        return false;
    });
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{\"x\": 1}");
    EXPECT_FALSE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), "");
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to handle input data: {\"x\": 1}")));
    EXPECT_FALSE(server.hasError());
}

TEST_F(ServerSocketTest, OutOfMemoryInTheHandlerRefusesTheRequest) {
    bool isJsons = false;
    HandlerSocket server([&isJsons](const Json::Value&, Json::Value&) -> bool {
        if (isJsons) {
            throw Json::RuntimeError("Failed to allocate string value buffer");
        }
        throw std::bad_alloc();
    });
    ASSERT_TRUE(server.serverBind());
    for (const bool value : {false, true}) {
        isJsons = value;
        const test::RawClient client;
        client.send("{}");
        EXPECT_FALSE(server.serverListen());
        EXPECT_EQ(client.receiveAll(), "");
    }
    const auto line = test::LogLine("socket.cpp", "Failed to handle input data: {}");
    EXPECT_THAT(systemLog(), ElementsAre(line, line));
    EXPECT_FALSE(server.hasError());
}

TEST_F(ServerSocketTest, OtherExceptionsOfTheHandlerPropagate) {
    HandlerSocket server([](const Json::Value&, Json::Value&) -> bool { throw std::logic_error("handler"); });
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{}");
    EXPECT_THROW(server.serverListen(), std::logic_error);
    EXPECT_EQ(client.receiveAll(), "");
}

TEST_F(ServerSocketTest, ReplyIsInitiallyNull) {
    HandlerSocket server([](const Json::Value&, Json::Value& reply) { return reply.isNull(); });
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{}");
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), "null");
}

// ---- Hostile and broken clients ----

struct HostileRequest {
    const char* name;
    std::string bytes;
};

void PrintTo(const HostileRequest& request, std::ostream* stream) {
    *stream << request.name;
}

class HostileRequestTest : public ServerSocketTest, public ::testing::WithParamInterface<HostileRequest> {};

TEST_P(HostileRequestTest, IsLoggedAndTheNextClientIsServed) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient hostile;
    hostile.send(GetParam().bytes);
    EXPECT_FALSE(server.serverListen());
    EXPECT_EQ(hostile.receiveAll(), "");
    const std::string text = GetParam().bytes.substr(0, 2095).c_str();
    EXPECT_THAT(systemLog(), ElementsAre(HasSubstr(" Failed to parse " + text + ", ")));

    const test::RawClient next;
    next.send("{}");
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(next.receiveAll(), R"({"got":{}})");
}

INSTANTIATE_TEST_SUITE_P(
    Requests, HostileRequestTest,
    ::testing::Values(HostileRequest{"NoJson", "hello"}, HostileRequest{"CutShort", "{\"act\":\"I\""},
                      HostileRequest{"NoColon", "{\"act\" \"I\"}"},
                      HostileRequest{"PrintfDirectives", "%s%n%m{"}, HostileRequest{"Bytes", "\x01\xff\xfe"},
                      HostileRequest{"ZeroByteFirst", std::string("\0{}", 3)},
                      HostileRequest{"OpenArrays", std::string(1100, '[')},
                      HostileRequest{"DeepArrays", std::string(1047, '[') + std::string(1047, ']')},
                      HostileRequest{"DeepInAnObject", "{\"a\":" + std::string(2000, '[')},
                      HostileRequest{"LongerThanTheBuffer", std::string(5000, 'x')}),
    test::CaseName());

TEST_F(ServerSocketTest, DeepNestingWithinTheLimitIsServed) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const std::string nested = std::string(900, '[') + std::string(900, ']');
    const test::RawClient client;
    client.send(nested);
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), "{\"got\":" + nested + "}");
}

TEST_F(ServerSocketTest, NonObjectsArePassedToTheHandler) {
    expectEchoes({"[1,2]", "7", "\"I\"", "null", "true"});
}

TEST_F(ServerSocketTest, RequestEndsAtFirstZeroByte) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send(std::string("{}\0garbage", 10));
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), R"({"got":{}})");
}

TEST_F(ServerSocketTest, ShortRequestOverwritesALongerOne) {
    expectEchoes({"[\"a long request comes first\"]", "[]"});
}

TEST_F(ServerSocketTest, EmptyConnectionFailsToParse) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    test::RawClient{};
    EXPECT_FALSE(server.serverListen());
    EXPECT_THAT(systemLog(), ElementsAre(HasSubstr(" Failed to parse , ")));
    EXPECT_FALSE(server.hasError());
}

TEST_F(ServerSocketTest, SilentClientBlocksTheNextUntilItCloses) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    test::RawClient silent;
    std::atomic<bool> isServed{false};
    std::thread next([&] {
        EXPECT_EQ(test::exchange("{}"), R"({"got":{}})");
        isServed = true;
    });
    EXPECT_FALSE(test::eventually(500ms, [&] { return isServed.load(); }));
    silent.close();
    EXPECT_TRUE(test::eventually(10s, [&] { return isServed.load(); }));
    next.join();
}

// ---- A client that disconnects before its reply ----

std::atomic<int> signals{0};

void countSignal(int) {
    ++signals;
}

bool isPending(int signal) {
    sigset_t pending;
    sigpending(&pending);
    return sigismember(&pending, signal) == 1;
}

class DisconnectedClientTest : public ServerSocketTest {
 protected:
    void SetUp() override {
        ServerSocketTest::SetUp();
        _client.emplace(makeServer());
        _client->send("{}");
    }

    void TearDown() override {
        _client.reset();
        _server.reset();
        ServerSocketTest::TearDown();
    }

    bool serve() { return _server->serverListen(); }

 private:
    const char* makeServer() {
        _server.emplace([this](const Json::Value&, Json::Value& reply) {
            _client->close();
            reply["late"] = true;
            return true;
        });
        EXPECT_TRUE(_server->serverBind());
        return test::LOCAL_SOCKET;
    }

    std::optional<HandlerSocket> _server;
    std::optional<test::RawClient> _client;
};

TEST_F(DisconnectedClientTest, LogsTwoLinesAndRaisesNoSigpipe) {
    EXPECT_FALSE(serve());
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to send output data: Broken pipe"),
                            test::LogLine("socket.cpp", "Data: {\"late\":true}")));
    EXPECT_FALSE(isPending(SIGPIPE));
}

TEST_F(DisconnectedClientTest, LeavesTheHostsSigpipeHandlerAlone) {
    struct sigaction action = {};
    action.sa_handler = countSignal;
    sigaction(SIGPIPE, &action, nullptr);
    EXPECT_FALSE(serve());
    EXPECT_EQ(signals, 0);
    sigaction(SIGPIPE, nullptr, &action);
    EXPECT_EQ(action.sa_handler, &countSignal);
    raise(SIGPIPE);  // neither blocked nor lost
    EXPECT_EQ(signals, 1);
}

TEST_F(DisconnectedClientTest, KeepsAnEarlierPendingSigpipe) {
    struct sigaction action = {};
    action.sa_handler = countSignal;
    sigaction(SIGPIPE, &action, nullptr);
    sigset_t pipe;
    sigemptyset(&pipe);
    sigaddset(&pipe, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &pipe, nullptr);
    raise(SIGPIPE);
    EXPECT_FALSE(serve());
    EXPECT_TRUE(isPending(SIGPIPE));
    EXPECT_EQ(signals, 0);
    pthread_sigmask(SIG_UNBLOCK, &pipe, nullptr);
    EXPECT_EQ(signals, 1);
}

TEST_F(DisconnectedClientTest, KeepsSigpipeBlockedAndLeavesNonePending) {
    sigset_t mask;
    sigemptyset(&mask);
    sigaddset(&mask, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &mask, nullptr);
    EXPECT_FALSE(serve());
    EXPECT_FALSE(isPending(SIGPIPE));
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGPIPE), 1);
}

TEST_F(DisconnectedClientTest, DoesNotBlockAHostThatIgnoresSigpipe) {
    std::signal(SIGPIPE, SIG_IGN);
    EXPECT_FALSE(serve());
    EXPECT_EQ(std::signal(SIGPIPE, SIG_DFL), SIG_IGN);
}

// ---- Binding ----

TEST_F(ServerSocketTest, ReplacesAStaleSocketFile) {
    {
        HandlerSocket earlier(echo);
        ASSERT_TRUE(earlier.serverBind());
    }
    ASSERT_TRUE(test::exists(test::LOCAL_SOCKET));
    HandlerSocket server(echo);
    EXPECT_TRUE(server.serverBind());
    const test::ServingThread serving(server);
    EXPECT_EQ(test::exchange("{}"), R"({"got":{}})");
}

TEST_F(ServerSocketTest, LongPathIsTruncatedTo107Characters) {
    const std::string path = "/tmp/" + std::string(115, 'x');
    const std::string cut = path.substr(0, 107);
    for (int run = 0; run < 2; ++run) {  // the second finds the file of the first
        HandlerSocket server(echo, path);
        EXPECT_TRUE(server.serverBind());
        EXPECT_TRUE(test::exists(cut));
        EXPECT_FALSE(test::exists(path));
        const test::ServingThread serving(server, cut);
        HandlerSocket client({}, path);
        Json::Value reply;
        EXPECT_TRUE(client.clientSend(Json::Value(7), reply));
        EXPECT_EQ(reply["got"], 7);
    }
    EXPECT_THAT(systemLog(),
                Each(HasSubstr(" Failed to parse , ")));  // the last, empty connections
}

TEST_F(ServerSocketTest, BacklogIsOneHundred) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    std::vector<std::unique_ptr<test::RawClient>> waiting;
    try {
        while (waiting.size() < 200) {
            waiting.push_back(std::make_unique<test::RawClient>(test::LOCAL_SOCKET, SOCK_NONBLOCK));
        }
    } catch (const std::system_error& error) {
        EXPECT_EQ(error.code().value(), EAGAIN);
    }
    EXPECT_EQ(waiting.size(), 101U);  // the kernel takes one more than it is told
}

TEST_F(ServerSocketTest, BindFailureIsAPermanentError) {
    HandlerSocket server(echo, "/tmp/nowhere/control.sock");
    EXPECT_FALSE(server.serverBind());
    EXPECT_TRUE(server.hasError());
    EXPECT_FALSE(server.serverListen());
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp",
                                          "Failed to bind socket /tmp/nowhere/control.sock: No such "
                                          "file or directory"),
                            test::LogLine("socket.cpp", "Failed to send content: has error")));
}

TEST_F(ServerSocketTest, ListenFailureIsAPermanentError) {
    HandlerSocket server(echo);
    {
        const test::FailingCall failing("listen", EADDRINUSE);
        EXPECT_FALSE(server.serverBind());
    }
    EXPECT_TRUE(server.hasError());
    EXPECT_FALSE(server.serverListen());
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to set listen: Address already in use"),
                            test::LogLine("socket.cpp", "Failed to send content: has error")));
}

TEST_F(ServerSocketTest, SocketFailureIsAPermanentError) {
    std::optional<HandlerSocket> server;
    {
        const test::FailingCall failing("socket", EMFILE);
        server.emplace(echo);
    }
    EXPECT_TRUE(server->hasError());
    EXPECT_FALSE(server->serverListen());
    Json::Value reply;
    EXPECT_FALSE(server->clientSend({}, reply));
    EXPECT_THAT(systemLog(), ElementsAre(test::LogLine("socket.cpp", "Failed to set socket"),
                                         test::LogLine("socket.cpp", "Failed to send content: has error"),
                                         test::LogLine("socket.cpp", "Failed to send content: has error")));
    errno = 0;
    server.reset();
    EXPECT_EQ(errno, 0);  // there is nothing to close
}

// ---- Interruptions ----

TEST_F(ServerSocketTest, SignalInterruptsAccept) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    {
        const test::Interruptions interruptions;
        EXPECT_FALSE(server.serverListen());
    }
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to accept: Interrupted system call")));
    EXPECT_FALSE(server.hasError());
    const test::ServingThread serving(server);
    EXPECT_EQ(test::exchange("{}"), R"({"got":{}})");
}

TEST_F(ServerSocketTest, SignalInterruptsRecv) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient silent;
    {
        const test::Interruptions interruptions;
        EXPECT_FALSE(server.serverListen());
    }
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to recv: Interrupted system call")));
    EXPECT_FALSE(server.hasError());
}

TEST_F(ServerSocketTest, AcceptFailureIsTemporary) {
    HandlerSocket server(echo);
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{}");
    {
        const test::NoDescriptors none;
        EXPECT_FALSE(server.serverListen());
    }
    EXPECT_THAT(systemLog(),
                ElementsAre(test::LogLine("socket.cpp", "Failed to accept: Too many open files")));
    EXPECT_TRUE(server.serverListen());
    EXPECT_EQ(client.receiveAll(), R"({"got":{}})");
}

TEST_F(ServerSocketTest, SocketsAreCloseOnExec) {
    int sockets = 0;
    int inherited = 0;
    HandlerSocket server([&](const Json::Value&, Json::Value&) {
        for (int fd = 3; fd < 100; ++fd) {
            struct stat info = {};
            if (fstat(fd, &info) == 0 && S_ISSOCK(info.st_mode)) {
                ++sockets;
                inherited += (fcntl(fd, F_GETFD) & FD_CLOEXEC) == 0 ? 1 : 0;
            }
        }
        return true;
    });
    ASSERT_TRUE(server.serverBind());
    const test::RawClient client;
    client.send("{}");
    EXPECT_TRUE(server.serverListen());
    EXPECT_GE(sockets, 3);  // the listening one and both ends of the connection
    EXPECT_EQ(inherited, 0);
}

}  // namespace
