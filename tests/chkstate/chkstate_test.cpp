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
using test::PEER_ADDRESS;
using test::PEER_PORT;
using test::UdpSocket;
using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::Field;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace {

constexpr unsigned int TIMEOUT = 10;  // seconds; for what arrives at once
constexpr const char* OWN_ADDRESS = "127.0.0.1";
constexpr const char* FOREIGN_ADDRESS = "192.0.2.1";  // of no host

// A transport with public fields.
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

// Uses the option number for 32-bit time: user-mode emulators of 32-bit machines lack the one for
// 64-bit time.
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
    // Send a probe and return the client's port as the peer sees it.
    std::uint16_t probe(HASocketCommClient& client) {
        EXPECT_EQ(client.Send("is_alive"), 8);
        const auto request = peer.receive(10s);
        return request ? request->port : std::uint16_t{0};
    }

    UdpSocket peer{PEER_ADDRESS, PEER_PORT};
};
class ServerTest : public test::SandboxTest {};

TEST_F(TransportTest, PortIs7499) {
    EXPECT_EQ(HA_PEER_PORT, 7499);
}

TEST_F(TransportTest, HasTheDocumentedLayout) {
    OpenServer server(OWN_ADDRESS, 7);
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

TEST_F(TransportTest, RecvIsTheFirstVirtualFunction) {
    static_assert(std::is_abstract_v<HASocketComm>);
    static_assert(!std::has_virtual_destructor_v<HASocketComm>);
    static_assert(!std::has_virtual_destructor_v<HASocketCommServer>);
    static_assert(!std::has_virtual_destructor_v<HASocketCommClient>);

    using Recv = int (*)(HASocketComm*, std::string&);
    HASocketCommServer server(OWN_ADDRESS, TIMEOUT);
    const Recv* table = nullptr;
    std::memcpy(static_cast<void*>(&table), static_cast<const void*>(&server), sizeof table);
    UdpSocket sender;
    sender.send("is_alive", OWN_ADDRESS, PEER_PORT);
    std::string text;
    EXPECT_EQ(table[0](&server, text), 8);
    EXPECT_EQ(text, "is_alive");
}

TEST_F(TransportTest, StartsWithTheGivenAddressAndThePort) {
    const OpenClient client("10.1.2.3", 1);
    EXPECT_EQ(client.peerAddr.sin_family, AF_INET);
    EXPECT_EQ(ntohs(client.peerAddr.sin_port), 7499);
    EXPECT_EQ(addressOf(client.peerAddr), "10.1.2.3");
}

TEST_F(TransportTest, SocketsAreCloseOnExec) {
    const OpenServer server(OWN_ADDRESS);
    const OpenClient client(OWN_ADDRESS, 1);
    EXPECT_EQ(fcntl(server.sockFd, F_GETFD), FD_CLOEXEC);
    EXPECT_EQ(fcntl(client.sockFd, F_GETFD), FD_CLOEXEC);
}

TEST_F(TransportTest, DestructorClosesTheSocket) {
    int descriptor = -1;
    {
        const OpenServer server(OWN_ADDRESS);
        descriptor = server.sockFd;
        EXPECT_NE(fcntl(descriptor, F_GETFD), -1);
    }
    EXPECT_EQ(fcntl(descriptor, F_GETFD), -1);
    HASocketCommServer successor(OWN_ADDRESS);
    EXPECT_FALSE(successor.HasError());
}

TEST_F(TransportTest, DescriptorZeroIsValid) {
    close(STDIN_FILENO);
    {
        OpenClient client(OWN_ADDRESS, 1);
        EXPECT_EQ(client.sockFd, STDIN_FILENO);
        EXPECT_FALSE(client.HasError());
    }
    EXPECT_EQ(fcntl(STDIN_FILENO, F_GETFD), -1);
    open("/dev/null", O_RDONLY);
}

TEST_F(TransportTest, SocketFailureIsLoggedAndEveryCallFails) {
    test::SystemLog log;
    {
        const test::FailingCall failing("socket", EMFILE);
        HASocketCommServer server(OWN_ADDRESS);
        EXPECT_EQ(errno, EMFILE);
        HASocketCommServer serverWithTimeout(OWN_ADDRESS, 1);
        HASocketCommClient client(OWN_ADDRESS, 1);
        for (HASocketComm* transport :
             std::initializer_list<HASocketComm*>{&server, &serverWithTimeout, &client}) {
            EXPECT_TRUE(transport->HasError());
            EXPECT_EQ(transport->Send("is_alive"), -1);
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

TEST_F(TransportTest, TimeoutOptionFailureIsAnErrorAndNothingIsBound) {
    test::SystemLog log;
    const test::FailingCall failing("setsockopt", EDOM);
    HASocketCommClient client(OWN_ADDRESS, 1);
    EXPECT_TRUE(client.HasError());
    HASocketCommServer server(OWN_ADDRESS, 1);
    EXPECT_TRUE(server.HasError());
    EXPECT_FALSE(test::isBound(OWN_ADDRESS, PEER_PORT));
    EXPECT_THAT(log.entries(), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(TransportTest, ServerWithoutTimeoutSetsNoOption) {
    const test::FailingCall failing("setsockopt", EDOM);
    HASocketCommServer server(OWN_ADDRESS);
    EXPECT_FALSE(server.HasError());
}

TEST_F(ServerTest, ForeignAddressIsAnError) {
    test::SystemLog log;
    EXPECT_TRUE(HASocketCommServer(FOREIGN_ADDRESS).HasError());
    EXPECT_TRUE(HASocketCommServer(FOREIGN_ADDRESS, 1).HasError());
    EXPECT_FALSE(HASocketCommServer(OWN_ADDRESS, 1).HasError());
    EXPECT_THAT(log.entries(), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, PortInUseIsAnError) {
    HASocketCommServer first(OWN_ADDRESS);
    EXPECT_FALSE(first.HasError());
    EXPECT_TRUE(HASocketCommServer(OWN_ADDRESS).HasError());
    HASocketCommServer second(OWN_ADDRESS, 1);
    EXPECT_TRUE(second.HasError());
    EXPECT_EQ(errno, EADDRINUSE);
}

TEST_F(ServerTest, ReceivesADatagramAndRepliesToItsSender) {
    HASocketCommServer server(OWN_ADDRESS, TIMEOUT);
    UdpSocket sender("127.0.0.3", 40000);
    sender.send("is_alive", OWN_ADDRESS, PEER_PORT);

    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(text, "is_alive");
    EXPECT_EQ(server.Send("alive"), 5);
    const auto reply = sender.receive(10s);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->bytes, "alive");
    EXPECT_EQ(reply->address, OWN_ADDRESS);
    EXPECT_EQ(reply->port, 7499);
}

TEST_F(ServerTest, ResetsTheAddressLengthBeforeEachReceive) {
    HASocketCommServer server(OWN_ADDRESS, TIMEOUT);
    server.peerAddrLen = 0;
    UdpSocket sender;
    sender.send("is_alive", OWN_ADDRESS, PEER_PORT);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(server.Send("alive"), 5);
    EXPECT_THAT(arrived(sender), ElementsAre("alive"));
}

TEST_F(ServerTest, RepliesToTheLastSenderOnly) {
    HASocketCommServer server(OWN_ADDRESS, TIMEOUT);
    UdpSocket first;
    UdpSocket second;
    first.send("1", OWN_ADDRESS, PEER_PORT);
    second.send("2", OWN_ADDRESS, PEER_PORT);

    std::string text;
    EXPECT_EQ(server.Recv(text), 1);
    EXPECT_EQ(server.Recv(text), 1);
    EXPECT_EQ(server.Send("alive"), 5);
    EXPECT_THAT(arrived(second), ElementsAre("alive"));
    EXPECT_THAT(arrived(first), IsEmpty());
}

TEST_F(ServerTest, SendsToItselfBeforeTheFirstRequest) {
    HASocketCommServer server(OWN_ADDRESS, TIMEOUT);
    EXPECT_EQ(server.Send("echo"), 4);
    std::string text;
    EXPECT_EQ(server.Recv(text), 4);
    EXPECT_EQ(text, "echo");
}

TEST_F(ServerTest, ForgetsTheSenderAfterATimeout) {
    HASocketCommServer server(OWN_ADDRESS, 1);
    UdpSocket sender;
    sender.send("is_alive", OWN_ADDRESS, PEER_PORT);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
    EXPECT_EQ(server.Recv(text), -1);
    EXPECT_EQ(server.Send("late reply"), -1);
    EXPECT_THAT(arrived(sender), IsEmpty());
}

TEST_F(ServerTest, TimesOutAndLeavesTheOutputUnchanged) {
    HASocketCommServer server(OWN_ADDRESS, 1);
    std::string text = "before";
    const test::Stopwatch watch;
    EXPECT_EQ(server.Recv(text), -1);
    EXPECT_GE(watch.elapsed(), 1s);
    EXPECT_EQ(text, "before");
}

TEST_F(ServerTest, WithoutTimeoutBlocksUntilADatagramArrives) {
    OpenServer server(OWN_ADDRESS);
    EXPECT_EQ(receiveTimeout(server.sockFd).tv_sec, 0);
    EXPECT_EQ(receiveTimeout(server.sockFd).tv_usec, 0);
    std::atomic<int> result{INT_MIN};
    std::string text;
    std::thread waiting([&] { result = server.Recv(text); });
    EXPECT_FALSE(test::eventually(1500ms, [&] { return result != INT_MIN; }));
    UdpSocket().send("is_alive", OWN_ADDRESS, PEER_PORT);
    waiting.join();
    EXPECT_EQ(result, 8);
    EXPECT_EQ(text, "is_alive");
}

TEST_F(ServerTest, SignalInterruptsTheWait) {
    static std::atomic<bool> caught{false};
    struct sigaction action = {};
    action.sa_handler = [](int) { caught = true; };
    ASSERT_EQ(sigaction(SIGUSR1, &action, nullptr), 0);

    HASocketCommServer server(OWN_ADDRESS);
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

// Receiving, which client and server share.
template <class Transport>
class ReceivingTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        if constexpr (std::is_same_v<Transport, HASocketCommServer>) {
            _transport.emplace(OWN_ADDRESS, TIMEOUT);
            _other.emplace(PEER_ADDRESS, PEER_PORT);
            _port = PEER_PORT;
        } else {
            _transport.emplace(PEER_ADDRESS, TIMEOUT);
            _other.emplace(PEER_ADDRESS, PEER_PORT);
            EXPECT_EQ(_transport->Send("is_alive"), 8);
            _port = _other->receive(10s).value().port;
        }
    }

    void TearDown() override {
        _transport.reset();
        _other.reset();
        SandboxTest::TearDown();
    }

    // Return the result and the text of Recv for a datagram.
    std::pair<int, std::string> receive(const std::string& datagram) {
        _other->send(datagram, OWN_ADDRESS, _port);
        std::string text = "before";
        const int result = _transport->Recv(text);
        return {result, text};
    }

    std::optional<Open<Transport>> _transport;
    std::optional<UdpSocket> _other;
    std::uint16_t _port = 0;
};

using Transports = ::testing::Types<HASocketCommServer, HASocketCommClient>;
TYPED_TEST_SUITE(ReceivingTest, Transports, );

TYPED_TEST(ReceivingTest, DatagramOf63BytesIsReceivedWhole) {
    const std::string text(63, 'x');
    EXPECT_EQ(this->receive(text), std::pair(63, text));
}

TYPED_TEST(ReceivingTest, LongerDatagramIsTruncatedTo63Bytes) {
    EXPECT_EQ(this->receive(std::string(63, 'x') + "y"), std::pair(63, std::string(63, 'x')));
    EXPECT_EQ(this->receive(std::string(50, 'a') + std::string(50, 'b')),
              std::pair(63, std::string(50, 'a') + std::string(13, 'b')));
    EXPECT_EQ(this->receive("next"), std::pair(4, "next"s));
}

TYPED_TEST(ReceivingTest, EmptyDatagramIsReceived) {
    EXPECT_EQ(this->receive(""), std::pair(0, ""s));
}

TYPED_TEST(ReceivingTest, TextEndsAtZeroByteButAllBytesAreCounted) {
    EXPECT_EQ(this->receive("ab\0cd"s), std::pair(5, "ab"s));
    EXPECT_EQ(this->receive("\0"s), std::pair(1, ""s));
    EXPECT_EQ(this->receive("\0"s + std::string(99, 'x')), std::pair(63, ""s));
}

TYPED_TEST(ReceivingTest, ShortDatagramOverwritesALongerOne) {
    EXPECT_EQ(this->receive("a long text"), std::pair(11, "a long text"s));
    EXPECT_EQ(this->receive("short"), std::pair(5, "short"s));
}

TEST_F(ClientTest, SendsExactlyTheBytesOfTheText) {
    HASocketCommClient client(PEER_ADDRESS, TIMEOUT);
    EXPECT_EQ(client.Send("is_alive"), 8);
    EXPECT_EQ(client.Send("a\0b"s), 3);
    EXPECT_EQ(client.Send(""), 0);
    EXPECT_EQ(client.Send(std::string(1000, 'x')), 1000);
    EXPECT_THAT(arrived(peer), ElementsAre("is_alive", "a\0b"s, "", std::string(1000, 'x')));
}

TEST_F(ClientTest, OversizedTextIsASendError) {
    HASocketCommClient client(PEER_ADDRESS, TIMEOUT);
    EXPECT_EQ(client.Send(std::string(65507, 'x')), 65507);
    EXPECT_EQ(client.Send(std::string(65508, 'x')), -1);
    EXPECT_THAT(arrived(peer), SizeIs(1));
}

TEST_F(ClientTest, SendsFromOneEphemeralPort) {
    HASocketCommClient client(PEER_ADDRESS, TIMEOUT);
    HASocketCommClient another(PEER_ADDRESS, TIMEOUT);
    const std::uint16_t port = probe(client);
    EXPECT_NE(port, 7499);
    EXPECT_NE(port, 0);
    EXPECT_EQ(probe(client), port);
    EXPECT_NE(probe(another), port);
}

TEST_F(ClientTest, ReplyFromAnotherAddressIsAccepted) {
    HASocketCommClient client(PEER_ADDRESS, TIMEOUT);
    const std::uint16_t port = probe(client);
    UdpSocket other("127.0.0.3");
    other.send("another address", OWN_ADDRESS, port);
    std::string text;
    EXPECT_EQ(client.Recv(text), 15);
    EXPECT_EQ(text, "another address");
    EXPECT_EQ(probe(client), port);
    EXPECT_THAT(arrived(other), IsEmpty());
}

TEST_F(ClientTest, TimesOutAndLeavesTheOutputUnchanged) {
    HASocketCommClient client(PEER_ADDRESS, 1);
    probe(client);
    std::string text = "before";
    const test::Stopwatch watch;
    EXPECT_EQ(client.Recv(text), -1);
    EXPECT_GE(watch.elapsed(), 1s);
    EXPECT_EQ(text, "before");
}

TEST_F(ClientTest, TimeoutIsInSeconds) {
    const OpenClient client(PEER_ADDRESS, 3);
    EXPECT_EQ(receiveTimeout(client.sockFd).tv_sec, 3);
    EXPECT_EQ(receiveTimeout(client.sockFd).tv_usec, 0);
    EXPECT_EQ(client.recvTimeout.seconds, 3U);
}

TEST_F(ClientTest, LongestTimeoutIsAccepted) {
    // User-mode emulators of 32-bit machines lack 64-bit time.
    constexpr unsigned int LONGEST = sizeof(long) == 8 ? UINT_MAX : INT_MAX;
    HASocketCommClient client(PEER_ADDRESS, LONGEST);
    EXPECT_FALSE(client.HasError());
    peer.send("alive", OWN_ADDRESS, probe(client));
    std::string text;
    EXPECT_EQ(client.Recv(text), 5);
}

class UnparsableAddressTest : public test::SandboxTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(UnparsableAddressTest, CountsAs0000) {
    UdpSocket own(OWN_ADDRESS, PEER_PORT);
    OpenClient client(GetParam(), 1);
    EXPECT_FALSE(client.HasError());
    EXPECT_EQ(addressOf(client.peerAddr), "0.0.0.0");
    EXPECT_EQ(client.Send("is_alive"), 8);
    EXPECT_THAT(arrived(own), ElementsAre("is_alive"));
}

TEST_P(UnparsableAddressTest, MakesAServerListenOnAllAddresses) {
    HASocketCommServer server(GetParam(), TIMEOUT);
    EXPECT_FALSE(server.HasError());
    UdpSocket sender;
    sender.send("is_alive", "127.0.0.77", PEER_PORT);
    std::string text;
    EXPECT_EQ(server.Recv(text), 8);
}

INSTANTIATE_TEST_SUITE_P(Texts, UnparsableAddressTest,
                         ::testing::Values("", "node-b", "127.0.0", "256.0.0.1", "127.0.0.1 ", "127.0.0.1\n",
                                           "::1", "2130706434"));

}  // namespace
