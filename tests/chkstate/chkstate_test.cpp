#include "chkstate.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/syscall.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <optional>
#include <thread>
#include <type_traits>
#include <utility>

#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using namespace std::string_literals;
using test::arrived;
using test::kPeerAddress;
using test::kPeerPort;
using test::UdpSocket;
using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::Field;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace {

constexpr unsigned int kTimeout = 10;  // seconds; for what arrives at once
constexpr const char* kOwnAddress = "127.0.0.1";
constexpr const char* kForeignAddress = "192.0.2.1";  // of no host

// A transport with its fields in reach.
template <class Transport>
class Open final : public Transport {
 public:
    using Transport::hasError;
    using Transport::peerAddr;
    using Transport::recvTimeout;
    using Transport::sockFd;
    using Transport::Transport;
};

using OpenServer = Open<HASocketCommServer>;
using OpenClient = Open<HASocketCommClient>;

// Read by the number that every kernel knows, with the types of that number: user-mode emulators of 32-bit
// machines do not know the option for 64-bit time.
struct KernelTime {
    long tv_sec;
    long tv_usec;
};

KernelTime receiveTimeout(int descriptor) {
    constexpr int RECEIVE_TIMEOUT = 20;
    KernelTime timeout = {-1, -1};
    socklen_t size = sizeof timeout;
    EXPECT_EQ(syscall(SYS_getsockopt, descriptor, SOL_SOCKET, RECEIVE_TIMEOUT, &timeout, &size), 0);
    return timeout;
}

std::string addressOf(const sockaddr_in& address) {
    char text[INET_ADDRSTRLEN] = "";
    inet_ntop(AF_INET, &address.sin_addr, text, sizeof text);
    return text;
}

class TransportTest : public test::SandboxTest {};
class ClientTest : public test::SandboxTest {
 protected:
    // Makes the client known to the peer, and returns the client's port.
    std::uint16_t ask(HASocketCommClient& client) {
        EXPECT_EQ(client.Send("question"), 8);
        const auto question = peer.receive(10s);
        return question ? question->port : std::uint16_t{0};
    }

    UdpSocket peer{kPeerAddress, kPeerPort};
};
class ServerTest : public test::SandboxTest {};

TEST_F(TransportTest, ThePortIs7499) {
    EXPECT_EQ(HA_PEER_PORT, 7499);
}

TEST_F(TransportTest, HasTheDocumentedLayout) {
    OpenServer server(kOwnAddress, 7);
    const auto* const begin = reinterpret_cast<const char*>(&server);
    const auto offset = [&](const auto& field) { return reinterpret_cast<const char*>(&field) - begin; };
    constexpr auto pointer = static_cast<std::ptrdiff_t>(sizeof(void*));

    EXPECT_EQ(offset(server.sockFd), pointer);
    EXPECT_EQ(offset(server.peerAddr), pointer + 4);
    EXPECT_EQ(offset(server.recvTimeout), pointer + 20);
    EXPECT_EQ(offset(server.hasError), pointer + 28);
    EXPECT_EQ(sizeof(HASocketComm), sizeof(void*) == 8 ? 40U : 36U);
    EXPECT_EQ(sizeof(HASocketCommServer), sizeof(void*) == 8 ? 48U : 40U);
    EXPECT_EQ(sizeof(HASocketCommClient), sizeof(HASocketComm));
    EXPECT_EQ(server.recvTimeout.seconds, 7U);
    EXPECT_EQ(server.recvTimeout.microseconds, 0);
}

TEST_F(TransportTest, RecvIsTheFirstVirtualOperationAndThereIsNoVirtualDestructor) {
    static_assert(std::is_abstract_v<HASocketComm>);
    static_assert(!std::has_virtual_destructor_v<HASocketComm>);
    static_assert(!std::has_virtual_destructor_v<HASocketCommServer>);
    static_assert(!std::has_virtual_destructor_v<HASocketCommClient>);

    using Recv = int (*)(HASocketComm*, std::string&);
    HASocketCommServer server(kOwnAddress, kTimeout);
    const Recv* table = nullptr;
    std::memcpy(&table, static_cast<const void*>(&server), sizeof table);
    UdpSocket asker;
    asker.send("question", kOwnAddress, kPeerPort);
    std::string text;
    EXPECT_EQ(table[0](&server, text), 8);
    EXPECT_EQ(text, "question");
}

TEST_F(TransportTest, StartsWithTheGivenAddressAndThePort) {
    const OpenClient client("10.1.2.3", 1);
    EXPECT_EQ(client.peerAddr.sin_family, AF_INET);
    EXPECT_EQ(ntohs(client.peerAddr.sin_port), 7499);
    EXPECT_EQ(addressOf(client.peerAddr), "10.1.2.3");
}

TEST_F(TransportTest, SocketsAreNotInheritedByPrograms) {
    const OpenServer server(kOwnAddress);
    const OpenClient client(kOwnAddress, 1);
    EXPECT_EQ(fcntl(server.sockFd, F_GETFD), FD_CLOEXEC);
    EXPECT_EQ(fcntl(client.sockFd, F_GETFD), FD_CLOEXEC);
}

TEST_F(TransportTest, TheDestructorClosesTheSocket) {
    int descriptor = -1;
    {
        const OpenServer server(kOwnAddress);
        descriptor = server.sockFd;
        EXPECT_NE(fcntl(descriptor, F_GETFD), -1);
    }
    EXPECT_EQ(fcntl(descriptor, F_GETFD), -1);
    HASocketCommServer successor(kOwnAddress);
    EXPECT_FALSE(successor.HasError());
}

TEST_F(TransportTest, DescriptorZeroIsOneLikeOthers) {
    close(STDIN_FILENO);
    {
        OpenClient client(kOwnAddress, 1);
        EXPECT_EQ(client.sockFd, STDIN_FILENO);
        EXPECT_FALSE(client.HasError());
    }
    EXPECT_EQ(fcntl(STDIN_FILENO, F_GETFD), -1);
    open("/dev/null", O_RDONLY);
}

TEST_F(TransportTest, WithoutASocketTheSystemLogSaysSoAndEveryCallFails) {
    test::SystemLog log;
    {
        const test::FailingCall failing("socket", EMFILE);
        HASocketCommServer server(kOwnAddress);
        EXPECT_EQ(errno, EMFILE);
        HASocketCommServer serverWithTimeout(kOwnAddress, 1);
        HASocketCommClient client(kOwnAddress, 1);
        for (HASocketComm* transport :
             std::initializer_list<HASocketComm*>{&server, &serverWithTimeout, &client}) {
            EXPECT_TRUE(transport->HasError());
            EXPECT_EQ(transport->Send("question"), -1);
            std::string text = "before";
            EXPECT_EQ(transport->Recv(text), -1);
            EXPECT_EQ(text, "before");
        }
    }
    const auto line =
        AllOf(Field(&test::SystemLog::Entry::priority, LOG_USER | LOG_ERR),
              Field(&test::SystemLog::Entry::text, test::LogLine("chkstate.cpp", "Failed to set socket")));
    EXPECT_THAT(log.entries(), ElementsAre(line, line, line));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(TransportTest, AnOptionThatCannotBeSetIsAnErrorAndNothingIsBound) {
    test::SystemLog log;
    const test::FailingCall failing("setsockopt", EDOM);
    HASocketCommClient client(kOwnAddress, 1);
    EXPECT_TRUE(client.HasError());
    HASocketCommServer server(kOwnAddress, 1);
    EXPECT_TRUE(server.HasError());
    EXPECT_FALSE(test::isBound(kOwnAddress, kPeerPort));
    EXPECT_THAT(log.entries(), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(TransportTest, AServerWithoutTimeoutSetsNoOption) {
    const test::FailingCall failing("setsockopt", EDOM);
    HASocketCommServer server(kOwnAddress);
    EXPECT_FALSE(server.HasError());
}

TEST_F(ServerTest, AnAddressThatTheHostDoesNotHaveIsAnError) {
    test::SystemLog log;
    EXPECT_TRUE(HASocketCommServer(kForeignAddress).HasError());
    EXPECT_TRUE(HASocketCommServer(kForeignAddress, 1).HasError());
    EXPECT_FALSE(HASocketCommServer(kOwnAddress, 1).HasError());
    EXPECT_THAT(log.entries(), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, APortThatIsTakenIsAnError) {
    HASocketCommServer first(kOwnAddress);
    EXPECT_FALSE(first.HasError());
    EXPECT_TRUE(HASocketCommServer(kOwnAddress).HasError());
    HASocketCommServer second(kOwnAddress, 1);
    EXPECT_TRUE(second.HasError());
    EXPECT_EQ(errno, EADDRINUSE);
}

TEST_F(ServerTest, ReceivesADatagramWithoutChangeAndAnswersItsSender) {
    HASocketCommServer server(kOwnAddress, kTimeout);
    UdpSocket asker("127.0.0.3", 40000);
    asker.send("question", kOwnAddress, kPeerPort);

    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(text, "question");
    EXPECT_EQ(server.Send("answer"), 6);
    const auto answer = asker.receive(10s);
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->bytes, "answer");
    EXPECT_EQ(answer->address, kOwnAddress);
    EXPECT_EQ(answer->port, 7499);
}

TEST_F(ServerTest, HasRoomForEachSendersAddress) {
    HASocketCommServer server(kOwnAddress, kTimeout);
    server.peerAddrLen = 0;
    UdpSocket asker;
    asker.send("question", kOwnAddress, kPeerPort);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(server.Send("answer"), 6);
    EXPECT_THAT(arrived(asker), ElementsAre("answer"));
}

TEST_F(ServerTest, AnswersOnlyWhoeverAskedLast) {
    HASocketCommServer server(kOwnAddress, kTimeout);
    UdpSocket first;
    UdpSocket second;
    first.send("1", kOwnAddress, kPeerPort);
    second.send("2", kOwnAddress, kPeerPort);

    std::string text;
    EXPECT_EQ(server.Recv(text), 1);
    EXPECT_EQ(server.Recv(text), 1);
    EXPECT_EQ(server.Send("answer"), 6);
    EXPECT_THAT(arrived(second), ElementsAre("answer"));
    EXPECT_THAT(arrived(first), IsEmpty());
}

TEST_F(ServerTest, ThatHasReceivedNothingSendsToItself) {
    HASocketCommServer server(kOwnAddress, kTimeout);
    EXPECT_EQ(server.Send("echo"), 4);
    std::string text;
    EXPECT_EQ(server.Recv(text), 4);
    EXPECT_EQ(text, "echo");
}

TEST_F(ServerTest, ForgetsTheSenderWhenNothingMoreComes) {
    HASocketCommServer server(kOwnAddress, 1);
    UdpSocket asker;
    asker.send("question", kOwnAddress, kPeerPort);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(server.Recv(text), -1);
    EXPECT_EQ(server.Send("late answer"), -1);
    EXPECT_THAT(arrived(asker), IsEmpty());
}

TEST_F(ServerTest, GivesUpAfterItsTimeoutAndLeavesTheOutputAlone) {
    HASocketCommServer server(kOwnAddress, 1);
    std::string text = "before";
    const test::Stopwatch watch;
    EXPECT_EQ(server.Recv(text), -1);
    EXPECT_GE(watch.elapsed(), 1s);
    EXPECT_EQ(text, "before");
}

TEST_F(ServerTest, WithoutTimeoutWaitsUntilADatagramComes) {
    OpenServer server(kOwnAddress);
    EXPECT_EQ(receiveTimeout(server.sockFd).tv_sec, 0);
    EXPECT_EQ(receiveTimeout(server.sockFd).tv_usec, 0);
    std::atomic<int> result{INT_MIN};
    std::string text;
    std::thread waiting([&] { result = server.Recv(text); });
    EXPECT_FALSE(test::eventually(1500ms, [&] { return result != INT_MIN; }));
    UdpSocket().send("question", kOwnAddress, kPeerPort);
    waiting.join();
    EXPECT_EQ(result, 8);
    EXPECT_EQ(text, "question");
}

TEST_F(ServerTest, ASignalEndsTheWait) {
    static std::atomic<bool> caught{false};
    struct sigaction action = {};
    action.sa_handler = [](int) { caught = true; };
    ASSERT_EQ(sigaction(SIGUSR1, &action, nullptr), 0);

    HASocketCommServer server(kOwnAddress);
    std::atomic<bool> done{false};
    const pthread_t receiver = pthread_self();
    std::thread signaller(
        [&] { test::eventually(30s, [&] { return done || (pthread_kill(receiver, SIGUSR1), false); }); });
    std::string text = "before";
    EXPECT_EQ(server.Recv(text), -1);
    done = true;
    signaller.join();
    EXPECT_TRUE(caught);
    EXPECT_EQ(text, "before");
}

// What both ends have in common when they receive.
template <class Transport>
class ReceivingTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        if constexpr (std::is_same_v<Transport, HASocketCommServer>) {
            transport_.emplace(kOwnAddress, kTimeout);
            other_.emplace(kPeerAddress, kPeerPort);
            port_ = kPeerPort;
        } else {
            transport_.emplace(kPeerAddress, kTimeout);
            other_.emplace(kPeerAddress, kPeerPort);
            EXPECT_EQ(transport_->Send("question"), 8);
            port_ = other_->receive(10s).value().port;
        }
    }

    void TearDown() override {
        transport_.reset();
        other_.reset();
        SandboxTest::TearDown();
    }

    // What Recv returns and gives for a datagram.
    std::pair<int, std::string> receive(const std::string& datagram) {
        other_->send(datagram, kOwnAddress, port_);
        std::string text = "before";
        const int result = transport_->Recv(text);
        return {result, text};
    }

    std::optional<Open<Transport>> transport_;
    std::optional<UdpSocket> other_;
    std::uint16_t port_ = 0;
};

using Transports = ::testing::Types<HASocketCommServer, HASocketCommClient>;
TYPED_TEST_SUITE(ReceivingTest, Transports, );

TYPED_TEST(ReceivingTest, ADatagramOf63BytesIsWhole) {
    const std::string text(63, 'x');
    EXPECT_EQ(this->receive(text), std::pair(63, text));
}

TYPED_TEST(ReceivingTest, ALongerDatagramIsCutAt63BytesAndItsRestIsLost) {
    EXPECT_EQ(this->receive(std::string(63, 'x') + "y"), std::pair(63, std::string(63, 'x')));
    EXPECT_EQ(this->receive(std::string(50, 'a') + std::string(50, 'b')),
              std::pair(63, std::string(50, 'a') + std::string(13, 'b')));
    EXPECT_EQ(this->receive("next"), std::pair(4, "next"s));
}

TYPED_TEST(ReceivingTest, AnEmptyDatagramCounts) {
    EXPECT_EQ(this->receive(""), std::pair(0, ""s));
}

TYPED_TEST(ReceivingTest, TheTextEndsAtAZeroByteButAllBytesAreCounted) {
    EXPECT_EQ(this->receive("ab\0cd"s), std::pair(5, "ab"s));
    EXPECT_EQ(this->receive("\0"s), std::pair(1, ""s));
    EXPECT_EQ(this->receive("\0"s + std::string(99, 'x')), std::pair(63, ""s));
}

TYPED_TEST(ReceivingTest, AShortTextDoesNotKeepTheEndOfALongerOne) {
    EXPECT_EQ(this->receive("a long text"), std::pair(11, "a long text"s));
    EXPECT_EQ(this->receive("short"), std::pair(5, "short"s));
}

TEST_F(ClientTest, SendsExactlyTheBytesOfTheText) {
    HASocketCommClient client(kPeerAddress, kTimeout);
    EXPECT_EQ(client.Send("question"), 8);
    EXPECT_EQ(client.Send("a\0b"s), 3);
    EXPECT_EQ(client.Send(""), 0);
    EXPECT_EQ(client.Send(std::string(1000, 'x')), 1000);
    EXPECT_THAT(arrived(peer), ElementsAre("question", "a\0b"s, "", std::string(1000, 'x')));
}

TEST_F(ClientTest, ATextThatFitsNoDatagramCannotBeSent) {
    HASocketCommClient client(kPeerAddress, kTimeout);
    EXPECT_EQ(client.Send(std::string(65507, 'x')), 65507);
    EXPECT_EQ(client.Send(std::string(65508, 'x')), -1);
    EXPECT_THAT(arrived(peer), SizeIs(1));
}

TEST_F(ClientTest, SendsFromOnePortThatTheSystemChose) {
    HASocketCommClient client(kPeerAddress, kTimeout);
    HASocketCommClient another(kPeerAddress, kTimeout);
    const std::uint16_t port = ask(client);
    EXPECT_NE(port, 7499);
    EXPECT_NE(port, 0);
    EXPECT_EQ(ask(client), port);
    EXPECT_NE(ask(another), port);
}

TEST_F(ClientTest, TakesAnAnswerFromAnybodyButKeepsAskingItsPeer) {
    HASocketCommClient client(kPeerAddress, kTimeout);
    const std::uint16_t port = ask(client);
    UdpSocket stranger("127.0.0.3");
    stranger.send("from a stranger", kOwnAddress, port);
    std::string text;
    EXPECT_EQ(client.Recv(text), 15);
    EXPECT_EQ(text, "from a stranger");
    EXPECT_EQ(ask(client), port);
    EXPECT_THAT(arrived(stranger), IsEmpty());
}

TEST_F(ClientTest, GivesUpAfterItsTimeoutAndLeavesTheOutputAlone) {
    HASocketCommClient client(kPeerAddress, 1);
    ask(client);
    std::string text = "before";
    const test::Stopwatch watch;
    EXPECT_EQ(client.Recv(text), -1);
    EXPECT_GE(watch.elapsed(), 1s);
    EXPECT_EQ(text, "before");
}

TEST_F(ClientTest, TheTimeoutIsInSeconds) {
    const OpenClient client(kPeerAddress, 3);
    EXPECT_EQ(receiveTimeout(client.sockFd).tv_sec, 3);
    EXPECT_EQ(receiveTimeout(client.sockFd).tv_usec, 0);
    EXPECT_EQ(client.recvTimeout.seconds, 3U);
}

TEST_F(ClientTest, TheLongestTimeoutIsNoError) {
    // Where the kernel knows 64-bit time; user-mode emulators of 32-bit machines do not.
    constexpr unsigned int LONGEST = sizeof(long) == 8 ? UINT_MAX : INT_MAX;
    HASocketCommClient client(kPeerAddress, LONGEST);
    EXPECT_FALSE(client.HasError());
    peer.send("answer", kOwnAddress, ask(client));
    std::string text;
    EXPECT_EQ(client.Recv(text), 6);
}

class UnparsableAddressTest : public test::SandboxTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(UnparsableAddressTest, CountsAs0000) {
    UdpSocket own(kOwnAddress, kPeerPort);
    OpenClient client(GetParam(), 1);
    EXPECT_FALSE(client.HasError());
    EXPECT_EQ(addressOf(client.peerAddr), "0.0.0.0");
    EXPECT_EQ(client.Send("question"), 8);
    EXPECT_THAT(arrived(own), ElementsAre("question"));
}

TEST_P(UnparsableAddressTest, MakesAServerListenOnAllAddresses) {
    HASocketCommServer server(GetParam(), kTimeout);
    EXPECT_FALSE(server.HasError());
    UdpSocket asker;
    asker.send("question", "127.0.0.77", kPeerPort);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
}

INSTANTIATE_TEST_SUITE_P(Texts, UnparsableAddressTest,
                         ::testing::Values("", "node-b", "127.0.0", "256.0.0.1", "127.0.0.1 ", "127.0.0.1\n",
                                           "::1", "2130706434"));

}  // namespace
