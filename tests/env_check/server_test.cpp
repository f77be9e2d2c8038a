// The passes of a server that runs.

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
using test::kPeerPort;
using test::kServer;
using test::UdpSocket;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::KilledBySignal;

namespace {

constexpr std::size_t kNameLimit = 63;

class Undefined : public EnvCheck {};
const CheckerRegister<Undefined> undefined("test_undefined");

class LongAnswer : public EnvCheck {
    std::string handle(Status&) override { return std::string(70, 'x'); }
};
const CheckerRegister<LongAnswer> longAnswer("test_long_answer");

class BinaryAnswer : public EnvCheck {
    std::string handle(Status&) override { return "a\0b"s; }
};
const CheckerRegister<BinaryAnswer> binaryAnswer("test_binary_answer");

class EmptyAnswer : public EnvCheck {
    std::string handle(Status&) override { return ""; }
};
const CheckerRegister<EmptyAnswer> emptyAnswer("test_empty_answer");

// Larger than any datagram.
class HugeAnswer : public EnvCheck {
    std::string handle(Status&) override { return std::string(65508, 'x'); }
};
const CheckerRegister<HugeAnswer> hugeAnswer("test_huge_answer");

const CheckerRegister<LongAnswer> longestName(std::string(kNameLimit, 'n'));
const CheckerRegister<LongAnswer> nameThatIsTooLong(std::string(kNameLimit + 7, 'm'));

class ServerTest : public test::SandboxTest {
 protected:
    // The socket of the server lives as long as the process: the first pass comes before the base's look at
    // the open descriptors.
    void SetUp() override {
        test::makeDirectories("/tmp/ha");
        localIP(kServer);
        auto firstPass = std::async(std::launch::async, [this] { return server(status); });
        ASSERT_TRUE(test::eventually(10s, [] { return isBound(kServer, kPeerPort); }));
        ask("is_alive");
        ASSERT_TRUE(firstPass.get());
        ASSERT_THAT(arrived(asker), ElementsAre("alive"));
        SandboxTest::SetUp();
    }

    void ask(const std::string& question) { asker.send(question, kServer, kPeerPort); }

    // What the server says to one question.
    std::vector<std::string> answersTo(const std::string& question) {
        ask(question);
        EXPECT_TRUE(server(status));
        return arrived(asker);
    }

    UdpSocket asker{"127.0.0.3", 40000};
    Status status;
    SocketServer server;
};

TEST_F(ServerTest, AnswersTheSenderAtItsAddressAndPort) {
    ask("is_alive");
    EXPECT_TRUE(server(status));
    const auto answer = asker.receive(0ms);
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->bytes, "alive");
    EXPECT_EQ(answer->address, kServer);
    EXPECT_EQ(answer->port, 7499);
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, AnswersFromTheStatusOfThePass) {
    EXPECT_THAT(answersTo("is_md_resync"), ElementsAre("not_resync"));
    status.isMDResync = true;
    EXPECT_THAT(answersTo("is_md_resync"), ElementsAre("resync"));
    status.isRemoteMDResync = true;
    status.isMDResync = false;
    EXPECT_THAT(answersTo("is_md_resync"), ElementsAre("not_resync"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ServerTest, AnswersTheHostNameAsTheFileHasIt) {
    test::writeFile("/tmp/.ha.hostname.original", "node-a\n");
    EXPECT_THAT(answersTo("remote_hostname"), ElementsAre("node-a\n"));
}

TEST_F(ServerTest, AnswersDiskErrorHandlingFromItsStatus) {
    status.isDiskErrHandling = true;
    Json::Value disks(Json::arrayValue);
    disks.append("sdb");
    status.setErrHandlingDisk(disks);
    EXPECT_THAT(answersTo("is_disk_err_handling"),
                ElementsAre(R"({"errHandlingDisk":["sdb"],"isDiskErrHandling":true})"));
}

TEST_F(ServerTest, ServesOneQuestionAPassInTheOrderOfArrival) {
    UdpSocket first;
    UdpSocket second;
    UdpSocket third;
    first.send("is_alive", kServer, kPeerPort);
    second.send("is_md_resync", kServer, kPeerPort);
    third.send("test_undefined", kServer, kPeerPort);

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

TEST_F(ServerTest, SendsExactlyTheBytesOfTheAnswer) {
    EXPECT_THAT(answersTo("test_long_answer"), ElementsAre(std::string(70, 'x')));
    EXPECT_THAT(answersTo("test_binary_answer"), ElementsAre("a\0b"s));
    EXPECT_THAT(answersTo("test_empty_answer"), ElementsAre(""));
}

TEST_F(ServerTest, ACheckWithoutAnAnswerOfItsOwnAnswersUndefine) {
    EXPECT_THAT(answersTo("test_undefined"), ElementsAre("Undefine"));
}

TEST_F(ServerTest, LogsAnAnswerThatCannotBeSentAndGoesOn) {
    EXPECT_THAT(answersTo("test_huge_answer"), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("env_check.cpp", "Failed to sendto")));
    EXPECT_THAT(answersTo("is_alive"), ElementsAre("alive"));
}

TEST_F(ServerTest, StaysAtTheAddressOfItsFirstPass) {
    localIP("127.0.0.9");
    EXPECT_THAT(answersTo("is_alive"), ElementsAre("alive"));
    EXPECT_FALSE(isBound("127.0.0.9", kPeerPort));
}

TEST_F(ServerTest, AllServersShareOneSocket) {
    static_assert(std::is_empty_v<SocketServer>);
    static_assert(!std::is_polymorphic_v<SocketServer>);
    ask("is_alive");
    EXPECT_TRUE(SocketServer()(status));
    EXPECT_THAT(arrived(asker), ElementsAre("alive"));
}

TEST_F(ServerTest, ServesACheckFromALibraryThatIsLoadedLater) {
    void* const library = dlopen(LATE_CHECK, RTLD_NOW | RTLD_NODELETE);
    ASSERT_NE(library, nullptr) << dlerror();
    EXPECT_THAT(answersTo("late_check"), ElementsAre("better late than never"));
    dlclose(library);
}

TEST_F(ServerTest, TheNameEndsAtAZeroByte) {
    EXPECT_THAT(answersTo("is_alive\0and more"s), ElementsAre("alive"));
}

TEST_F(ServerTest, TheNameEndsAfter63Bytes) {
    EXPECT_THAT(answersTo(std::string(kNameLimit, 'n')), ElementsAre(std::string(70, 'x')));
    EXPECT_THAT(answersTo(std::string(kNameLimit, 'n') + " and more"), ElementsAre(std::string(70, 'x')));
}

TEST_F(ServerTest, ASignalEndsThePassWithoutAWord) {
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
    EXPECT_THAT(answersTo("is_alive"), ElementsAre("alive"));
}

TEST_F(ServerTest, KeepsNoCheckAfterItsPass) {
    answersTo("is_alive");
    const std::size_t before = mallinfo2().uordblks;
    for (int i = 0; i < 100; ++i) {
        answersTo("is_alive");
    }
    // Under the sanitizers, which bring an allocator of their own, it is the leak checker that looks.
    EXPECT_LT(mallinfo2().uordblks, before + 100 * sizeof(EnvCheck));
}

class UnknownNameTest : public ServerTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(UnknownNameTest, EndsTheProcessWithoutAnAnswerOrALogLine) {
    ask(GetParam());
    EXPECT_EXIT(server(status), KilledBySignal(SIGABRT), "");
    EXPECT_THAT(arrived(asker), IsEmpty());
    EXPECT_EQ(test::bufferText(), "");
}

INSTANTIATE_TEST_SUITE_P(Names, UnknownNameTest,
                         ::testing::Values("", "unknown", "Undefine", "is_aliv", "is_alive ", "is_alive\n",
                                           " is_alive", "IS_ALIVE", "is_alivereboot_remote", "\0is_alive"s,
                                           std::string(kNameLimit + 7, 'm')));

TEST_F(ServerTest, WithoutARegistryEveryNameIsUnknown) {
    ask("is_alive");
    EXPECT_EXIT(
        {
            CheckerFactory::opMap = nullptr;
            server(status);
        },
        KilledBySignal(SIGABRT), "");
    EXPECT_THAT(arrived(asker), IsEmpty());
}

}  // namespace
