// The passes of a running server.

#include <dlfcn.h>
#include <malloc.h>
#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>
#include <type_traits>

#include "checker.h"
#include "env_check.h"
#include "env_check/peer.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using namespace std::string_literals;
using TERN::HA::Daemon::Status;
using test::arrived;
using test::isBound;
using test::PEER_PORT;
using test::SERVER;
using test::UdpSocket;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::KilledBySignal;

namespace {

constexpr std::size_t NAME_LIMIT = 63;

class Undefined : public EnvCheck {};
const CheckerRegister<Undefined> undefined("test_undefined");

class LongReply : public EnvCheck {
    std::string handle(Status&) override { return std::string(70, 'x'); }
};
const CheckerRegister<LongReply> longReply("test_long_reply");

class BinaryReply : public EnvCheck {
    std::string handle(Status&) override { return "a\0b"s; }
};
const CheckerRegister<BinaryReply> binaryReply("test_binary_reply");

class EmptyReply : public EnvCheck {
    std::string handle(Status&) override { return ""; }
};
const CheckerRegister<EmptyReply> emptyReply("test_empty_reply");

// Has no memory for JSON.
class JsonReply : public EnvCheck {
    std::string handle(Status&) override {
        throw Json::RuntimeError("Failed to allocate string value buffer");
    }
};
const CheckerRegister<JsonReply> jsonReply("test_json_reply");

// Larger than any datagram.
class HugeReply : public EnvCheck {
    std::string handle(Status&) override { return std::string(65508, 'x'); }
};
const CheckerRegister<HugeReply> hugeReply("test_huge_reply");

const CheckerRegister<LongReply> longestName(std::string(NAME_LIMIT, 'n'));
const CheckerRegister<LongReply> nameThatIsTooLong(std::string(NAME_LIMIT + 7, 'm'));

class ServerTest : public test::SandboxTest {
 protected:
    // The server socket stays open until the process ends: the first pass precedes the base's count
    // of open descriptors.
    void SetUp() override {
        test::makeDirectories("/tmp/ha");
        localIP(SERVER);
        auto firstPass = std::async(std::launch::async, [this] { return server(status); });
        ASSERT_TRUE(test::eventually(10s, [] { return isBound(SERVER, PEER_PORT); }));
        send("is_alive");
        ASSERT_TRUE(firstPass.get());
        ASSERT_THAT(arrived(client), ElementsAre("alive"));
        SandboxTest::SetUp();
    }

    void send(const std::string& request) { client.send(request, SERVER, PEER_PORT); }

    // The replies of one pass to a request.
    std::vector<std::string> repliesTo(const std::string& request) {
        send(request);
        EXPECT_TRUE(server(status));
        return arrived(client);
    }

    UdpSocket client{"127.0.0.3", 40000};
    Status status;
    SocketServer server;
};

TEST_F(ServerTest, RepliesToTheSendersAddressAndPort) {
    send("is_alive");
    EXPECT_TRUE(server(status));
    const auto reply = client.receive(0ms);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->bytes, "alive");
    EXPECT_EQ(reply->address, SERVER);
    EXPECT_EQ(reply->port, 7499);
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, OutOfMemoryForJsonDropsTheRequest) {
    EXPECT_THAT(repliesTo("test_json_reply"), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_THAT(repliesTo("is_alive"), ElementsAre("alive"));
}

TEST_F(ServerTest, RepliesFromTheStatusOfThePass) {
    EXPECT_THAT(repliesTo("is_md_resync"), ElementsAre("not_resync"));
    status.isMDResync = true;
    EXPECT_THAT(repliesTo("is_md_resync"), ElementsAre("resync"));
    status.isRemoteMDResync = true;
    status.isMDResync = false;
    EXPECT_THAT(repliesTo("is_md_resync"), ElementsAre("not_resync"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, RepliesWithTheHostnameFile) {
    test::writeFile("/tmp/.ha.hostname.original", "node-a\n");
    EXPECT_THAT(repliesTo("remote_hostname"), ElementsAre("node-a\n"));
}

TEST_F(ServerTest, RepliesWithDiskErrorHandlingOfTheStatus) {
    status.isDiskErrHandling = true;
    Json::Value disks(Json::arrayValue);
    disks.append("sdb");
    status.setErrHandlingDisk(disks);
    EXPECT_THAT(repliesTo("is_disk_err_handling"),
                ElementsAre(R"({"errHandlingDisk":["sdb"],"isDiskErrHandling":true})"));
}

TEST_F(ServerTest, ServesOneRequestPerPassInOrderOfArrival) {
    UdpSocket first;
    UdpSocket second;
    UdpSocket third;
    first.send("is_alive", SERVER, PEER_PORT);
    second.send("is_md_resync", SERVER, PEER_PORT);
    third.send("test_undefined", SERVER, PEER_PORT);

    EXPECT_TRUE(server(status));
    EXPECT_THAT(arrived(first), ElementsAre("alive"));
    EXPECT_THAT(arrived(second), IsEmpty());
    EXPECT_TRUE(server(status));
    EXPECT_THAT(arrived(second), ElementsAre("not_resync"));
    EXPECT_THAT(arrived(third), IsEmpty());
    EXPECT_TRUE(server(status));
    EXPECT_THAT(arrived(third), ElementsAre("Undefine"));
    EXPECT_THAT(arrived(first), IsEmpty());
}

TEST_F(ServerTest, SendsExactlyTheBytesOfTheReply) {
    EXPECT_THAT(repliesTo("test_long_reply"), ElementsAre(std::string(70, 'x')));
    EXPECT_THAT(repliesTo("test_binary_reply"), ElementsAre("a\0b"s));
    EXPECT_THAT(repliesTo("test_empty_reply"), ElementsAre(""));
}

TEST_F(ServerTest, CheckWithoutAHandlerRepliesUndefine) {
    EXPECT_THAT(repliesTo("test_undefined"), ElementsAre("Undefine"));
}

TEST_F(ServerTest, LogsSendFailureAndKeepsServing) {
    EXPECT_THAT(repliesTo("test_huge_reply"), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("env_check.cpp", "Failed to sendto")));
    EXPECT_THAT(repliesTo("is_alive"), ElementsAre("alive"));
}

TEST_F(ServerTest, KeepsTheAddressOfItsFirstPass) {
    localIP("127.0.0.9");
    EXPECT_THAT(repliesTo("is_alive"), ElementsAre("alive"));
    EXPECT_FALSE(isBound("127.0.0.9", PEER_PORT));
}

TEST_F(ServerTest, AllServersShareOneSocket) {
    static_assert(std::is_empty_v<SocketServer>);
    static_assert(!std::is_polymorphic_v<SocketServer>);
    send("is_alive");
    EXPECT_TRUE(SocketServer()(status));
    EXPECT_THAT(arrived(client), ElementsAre("alive"));
}

TEST_F(ServerTest, ServesACheckOfALibraryLoadedLater) {
    void* const library = dlopen(LATE_CHECK, RTLD_NOW | RTLD_NODELETE);
    ASSERT_NE(library, nullptr) << dlerror();
    EXPECT_THAT(repliesTo("late_check"), ElementsAre("better late than never"));
    dlclose(library);
}

TEST_F(ServerTest, RequestEndsAtFirstZeroByte) {
    EXPECT_THAT(repliesTo("is_alive\0and more"s), ElementsAre("alive"));
}

TEST_F(ServerTest, RequestIsTruncatedTo63Bytes) {
    EXPECT_THAT(repliesTo(std::string(NAME_LIMIT, 'n')), ElementsAre(std::string(70, 'x')));
    EXPECT_THAT(repliesTo(std::string(NAME_LIMIT, 'n') + " and more"), ElementsAre(std::string(70, 'x')));
}

TEST_F(ServerTest, SignalEndsThePassSilently) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    ASSERT_EQ(sigaction(SIGUSR1, &action, nullptr), 0);
    std::atomic<bool> done{false};
    const pthread_t serving = pthread_self();
    std::thread signaller(
        [&] { test::eventually(60s, [&] { return done || (pthread_kill(serving, SIGUSR1), false); }); });
    const test::Stopwatch watch;
    EXPECT_TRUE(server(status));
    EXPECT_LT(watch.elapsed(), 20s);
    done = true;
    signaller.join();
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_THAT(repliesTo("is_alive"), ElementsAre("alive"));
}

TEST_F(ServerTest, DeletesTheCheckAfterThePass) {
    repliesTo("is_alive");
    const std::size_t before = mallinfo2().uordblks;
    for (int i = 0; i < 100; ++i) {
        repliesTo("is_alive");
    }
    // The sanitizers have their own allocator; with them the leak checker does this check.
    EXPECT_LT(mallinfo2().uordblks, before + 100 * sizeof(EnvCheck));
}

class UnknownRequestTest : public ServerTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(UnknownRequestTest, AbortsWithoutReplyOrLogLine) {
    send(GetParam());
    EXPECT_EXIT(server(status), KilledBySignal(SIGABRT), "");
    EXPECT_THAT(arrived(client), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

INSTANTIATE_TEST_SUITE_P(Names, UnknownRequestTest,
                         ::testing::Values("", "unknown", "Undefine", "is_aliv", "is_alive ", "is_alive\n",
                                           " is_alive", "IS_ALIVE", "is_alivereboot_remote", "\0is_alive"s,
                                           std::string(NAME_LIMIT + 7, 'm')));

TEST_F(ServerTest, MissingRegistryMakesEveryRequestUnknown) {
    send("is_alive");
    EXPECT_EXIT(
        {
            CheckerFactory::opMap = nullptr;
            server(status);
        },
        KilledBySignal(SIGABRT), "");
    EXPECT_THAT(arrived(client), IsEmpty());
}

}  // namespace
