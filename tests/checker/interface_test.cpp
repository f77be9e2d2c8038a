#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/udp.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::InterfaceChecker;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;

constexpr char TITLE[] = "Iface      MTU    RX-OK RX-ERR RX-DRP RX-OVR    TX-OK TX-ERR TX-DRP TX-OVR Flg";

class InterfaceTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        drbdIF("eth1");
    }

    // Replace ifconfig by a stub that prints `output` and then runs `end`.
    static void print(const std::string& output, const std::string& end = "exit 0") {
        test::replaceProgram("/sbin/ifconfig", "cat <<'END'\n" + output + "\nEND\n" + end);
    }

    static std::string line(const std::string& interface, const std::string& rest) {
        return std::string(TITLE) + "\nlo 65536 7 7 7 7 7 7 7 7 LRU\n" + interface + " 1500 " + rest +
               " BMRU";
    }

    // Take a sample, which must succeed, and return its rate.
    float sample() {
        float rate = -7.0F;
        EXPECT_TRUE(checker.networkNonOkRate(rate));
        return rate;
    }

    void expectFailure(const ::testing::Matcher<std::vector<std::string>>& lines) {
        float rate = -7.0F;
        EXPECT_FALSE(checker.networkNonOkRate(rate));
        EXPECT_EQ(rate, -7.0F);
        EXPECT_THAT(test::daemonLogMessages(), lines);
    }

    InterfaceChecker checker;
};

TEST_F(InterfaceTest, RealIfconfigCountsPackets) {
    drbdIF("lo");
    test::UdpSocket socket("127.0.0.1");
    socket.send("packet", "127.0.0.1", socket.port());
    ASSERT_TRUE(socket.receive(5s).has_value());
    EXPECT_EQ(sample(), 0.0F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

// Guards the test above: with an unknown title its rate would be 0, too.
TEST_F(InterfaceTest, RealIfconfigListingHasTheExpectedFormat) {
    test::UdpSocket socket("127.0.0.1");
    socket.send("packet", "127.0.0.1", socket.port());
    ASSERT_TRUE(socket.receive(5s).has_value());
    const std::vector<std::string> output = test::lines(test::run({"/sbin/ifconfig", "-s"}).output);
    EXPECT_THAT(output, Contains(MatchesRegex("Iface +MTU +RX-OK +RX-ERR .* TX-OK +TX-ERR .*")));
    EXPECT_THAT(output, Contains(MatchesRegex("lo +[0-9]+ +[1-9][0-9]* +0 .*")));
}

TEST_F(InterfaceTest, IfconfigIsRunWithTheShortOption) {
    test::replaceProgram("/sbin/ifconfig", "printf '%s\\n' \"$#\" \"$@\" > /tmp/arguments");
    float rate = 0;
    checker.networkNonOkRate(rate);
    EXPECT_EQ(test::readFile("/tmp/arguments"), "1\n-s\n");
}

TEST_F(InterfaceTest, FirstSampleCoversAllPacketsSoFar) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), 5.0F / 2000.0F);
    print(line("eth1", "1000 5 0 0 1005 0 0 0"));  // 10 more are OK: the totals were kept
    EXPECT_EQ(sample(), 0.0F);
    print(line("eth1", "1003 6 1 1 1006 1 1 1"));
    EXPECT_FLOAT_EQ(sample(), 6.0F / 10.0F);
}

TEST_F(InterfaceTest, NoTrafficYieldsRateZero) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    sample();
    EXPECT_EQ(sample(), 0.0F);
}

TEST_F(InterfaceTest, ColumnsAreFoundByName) {
    print(
        "Iface   MTU Met   RX-OK RX-ERR RX-DRP RX-OVR    TX-OK TX-ERR TX-DRP TX-OVR Flg\n"
        "eth1 1500 0 1000 5 0 0 995 0 0 0 BMRU");
    EXPECT_FLOAT_EQ(sample(), 0.0025F);
}

TEST_F(InterfaceTest, OnlyRxAndTxColumnsCount) {
    print("Iface xRX-ERR OK TXQ RX-OK\neth1 100 100 1 3");
    EXPECT_FLOAT_EQ(sample(), 0.25F);
}

TEST_F(InterfaceTest, CountersMayBeHexadecimalOrOctal) {
    print(line("eth1", "0x10 010 0 0 0 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), 8.0F / 24.0F);
}

TEST_F(InterfaceTest, TrailingCharactersOfACounterAreIgnored) {
    print(line("eth1", "6abc none 2 0 0 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), 2.0F / 8.0F);
}

TEST_F(InterfaceTest, DecreasingCountersYieldANegativeRate) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    sample();
    print(line("eth1", "2000 0 0 0 2000 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), -5.0F / 2000.0F);
}

TEST_F(InterfaceTest, RateIsNotClamped) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    sample();
    print(line("eth1", "990 25 0 0 995 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), 2.0F);
}

TEST_F(InterfaceTest, RateIsDividedInSinglePrecision) {
    print(line("eth1", "1 16777217 0 0 0 0 0 0"));
    EXPECT_EQ(sample(), 16777216.0F / 16777218.0F);  // in double precision it rounds to another float
}

TEST_F(InterfaceTest, UnlistedInterfaceUsesColumnIndexesAsCounters) {
    print(line("eth0", "1000 5 0 0 995 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), (3.0F + 4 + 5 + 7 + 8 + 9) / (2 + 3 + 4 + 5 + 6 + 7 + 8 + 9));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(InterfaceTest, UnknownTitleNegatesTheTotals) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    sample();
    print("Kernel Interface table\neth1 1500 1 1 1 1 1 1 1 1 BMRU");
    EXPECT_FLOAT_EQ(sample(), -5.0F / -2000.0F);
    EXPECT_EQ(sample(), 0.0F);  // now nothing is left
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(InterfaceTest, FirstLineBeginningWithTheNameCounts) {
    const std::string eth1 = "eth1 1500 100 0 0 0 0 0 0 0 BMRU\n";
    const std::string eth10 = "eth10 1500 0 100 0 0 0 0 0 0 BMRU\n";
    print(std::string(TITLE) + "\n" + eth1 + eth10);
    EXPECT_EQ(sample(), 0.0F);
    checker = {};
    print(std::string(TITLE) + "\n" + eth10 + eth1);
    EXPECT_EQ(sample(), 1.0F);
}

TEST_F(InterfaceTest, RepeatedColumnCountsOnce) {
    print("Iface RX-OK RX-ERR RX-ERR\neth1 60 40 340");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
}

TEST_F(InterfaceTest, InterfaceNameMayBeOneCharacter) {
    drbdIF("x");
    print("Iface RX-OK RX-ERR\nx 60 40");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
}

TEST_F(InterfaceTest, ColumnsAreSeparatedByAnyWhitespace) {
    print("Iface\tRX-OK \v RX-ERR\f\r\neth1\t60\r40\v");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
}

TEST_F(InterfaceTest, RateIsTheShareOfNonOkPackets) {
    EXPECT_FLOAT_EQ(checker._rateCaculate(5, 1995), 0.0025F);
    EXPECT_EQ(checker._rateCaculate(0, 7), 0.0F);
    EXPECT_EQ(checker._rateCaculate(7, 0), 1.0F);
    EXPECT_EQ(checker._rateCaculate(1, 0), 1.0F);
    EXPECT_EQ(checker._rateCaculate(0, 0), 0.0F);
    EXPECT_EQ(checker._rateCaculate(7, -7), 0.0F);
    EXPECT_EQ(checker._rateCaculate(-5, 15), -0.5F);
}

TEST_F(InterfaceTest, RateCoversPacketsSinceThePreviousSample) {
    EXPECT_FLOAT_EQ(checker._rateGet({{"RX-ERR", 10}, {"RX-OK", 20}, {"an OK amid", 30}, {"x", 40}}), 0.5F);
    EXPECT_EQ(checker._lastOkTotal, 50);
    EXPECT_EQ(checker._lastNonOkTotal, 50);
    EXPECT_FLOAT_EQ(checker._rateGet({{"RX-ERR", 51}, {"RX-OK", 53}}), 0.25F);
    EXPECT_EQ(checker._lastOkTotal, 53);
    EXPECT_EQ(checker._lastNonOkTotal, 51);
    EXPECT_EQ(checker._rateGet({}), 51.0F / 104.0F);
}

TEST_F(InterfaceTest, CountersAreReplacedOnlyOnSuccess) {
    const std::map<std::string, long long> before = {{"RX-OK", 1}, {"before", 2}};
    std::map<std::string, long long> counters = before;
    for (const char* rest : {"1500 99999999999999999999 5", "1500 60"}) {
        print(std::string("Iface MTU RX-OK RX-ERR\neth1 ") + rest);
        EXPECT_FALSE(checker._interfaceDetail("eth1", counters));
        EXPECT_EQ(counters, before) << rest;
    }
    test::replaceProgram("/sbin/ifconfig", "exit 0");
    EXPECT_FALSE(checker._interfaceDetail("eth1", counters));
    EXPECT_EQ(counters, before);
    test::hideProgram("/sbin/ifconfig");
    EXPECT_FALSE(checker._interfaceDetail("eth1", counters));
    EXPECT_EQ(counters, before);
    test::restoreProgram("/sbin/ifconfig");

    print("Iface MTU RX-OK RX-ERR\neth1 1500 60 40");
    EXPECT_TRUE(checker._interfaceDetail("eth1", counters));
    EXPECT_THAT(counters, ElementsAre(std::pair("RX-ERR", 40), std::pair("RX-OK", 60)));
    EXPECT_TRUE(checker._interfaceDetail("eth2", counters));
    EXPECT_THAT(counters, ElementsAre(std::pair("RX-ERR", 3), std::pair("RX-OK", 2)));
    print("no title\neth1 1500 60 40");
    EXPECT_TRUE(checker._interfaceDetail("eth1", counters));
    EXPECT_THAT(counters, IsEmpty());
}

TEST_F(InterfaceTest, LongLinesAreReadInChunksOf511Bytes) {
    // The last column begins with the second chunk of the title; each chunk counts as a line.
    const std::string title = "Iface RX-OK" + std::string(500, ' ');
    ASSERT_EQ(title.size(), 511U);
    print(title + "RX-ERR\neth1 60 40");
    EXPECT_EQ(sample(), 0.0F);
    checker = {};
    print("Iface RX-OK RX-ERR\n" + std::string(511, 'x') + "eth1 60 40");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
}

TEST_F(InterfaceTest, LinesAfterTheFirstMatchMayBeMalformed) {
    print(line("eth1", "60 40 0 0 0 0 0 0") + "\neth1 1500\neth1 1500 99999999999999999999 0 0 0 0 0 0 0");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(InterfaceTest, ListingIsReadToTheEnd) {
    // Exceeds the capacity of a pipe: SIGPIPE would end ifconfig if reading stopped early.
    print(line("eth1", "60 40 0 0 0 0 0 0"), "printf '%0200000d' 0; exit 0");
    EXPECT_FLOAT_EQ(sample(), 0.4F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(InterfaceTest, IfconfigStartFailureLogsThreeLines) {
    test::hideProgram("/sbin/ifconfig");
    expectFailure(ElementsAre(test::LogLine("checker.cpp", "Failed to exec command: /sbin/ifconfig"),
                              test::LogLine("checker.cpp", "Failed to exec ifconfig to get interface status"),
                              test::LogLine("checker.cpp", "Failed to get interface detail")));
}

TEST_F(InterfaceTest, EmptyOutputIsAFailure) {
    test::replaceProgram("/sbin/ifconfig", "exit 0");
    expectFailure(ElementsAre(test::LogLine("checker.cpp", "Failed to get title from ifconfig output"),
                              test::LogLine("checker.cpp", "Failed to get interface detail")));
}

TEST_F(InterfaceTest, EmptyOutputAndExitStatusLogThreeLines) {
    test::replaceProgram("/sbin/ifconfig", "exit 1");
    expectFailure(ElementsAre(test::LogLine("checker.cpp", "Failed to get title from ifconfig output"),
                              test::LogLine("checker.cpp", "Failed to exec /sbin/ifconfig return code: 256"),
                              test::LogLine("checker.cpp", "Failed to get interface detail")));
}

TEST_F(InterfaceTest, ExitStatusAfterAListingIsOnlyLogged) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"), "exit 3");
    EXPECT_FLOAT_EQ(sample(), 0.0025F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /sbin/ifconfig return code: 768")));
}

class OutOfRangeTest : public InterfaceTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(OutOfRangeTest, IsAFailure) {
    print(line("eth1", std::string("1000 ") + GetParam() + " 0 0 995 0 0 0"));
    expectFailure(ElementsAre(test::LogLine("checker.cpp", std::string("strtoll failed: ") + GetParam()),
                              test::LogLine("checker.cpp", "Failed to get interface detail")));
}

INSTANTIATE_TEST_SUITE_P(Counters, OutOfRangeTest,
                         ::testing::Values("9223372036854775807", "-9223372036854775808",
                                           "99999999999999999999", "-99999999999999999999",
                                           "0x7fffffffffffffff"));

TEST_F(InterfaceTest, OutOfRangeCounterIsLoggedBeforeTheExitStatus) {
    print(line("eth1", "99999999999999999999 0 0 0 0 0 0 0"), "exit 1");
    expectFailure(ElementsAre(test::LogLine("checker.cpp", "strtoll failed: 99999999999999999999"),
                              test::LogLine("checker.cpp", "Failed to exec /sbin/ifconfig return code: 256"),
                              test::LogLine("checker.cpp", "Failed to get interface detail")));
}

TEST_F(InterfaceTest, LargestCountersAreHandled) {
    print(line("eth1",
               "9223372036854775806 9223372036854775806 9223372036854775806 0 9223372036854775806 0 0 0"));
    sample();
    EXPECT_EQ(sample(), 0.0F);
}

TEST_F(InterfaceTest, TooShortLineIsAFailure) {
    print(std::string(TITLE) + "\neth1 1500 1000 5 0 0 995 0 0");
    expectFailure(ElementsAre(test::LogLine("checker.cpp", "Failed to get interface detail")));
}

TEST_F(InterfaceTest, FailureKeepsThePreviousTotals) {
    print(line("eth1", "1000 5 0 0 995 0 0 0"));
    sample();
    print(line("eth1", "x"));
    float rate = 0;
    EXPECT_FALSE(checker.networkNonOkRate(rate));
    print(line("eth1", "1009 6 0 0 995 0 0 0"));
    EXPECT_FLOAT_EQ(sample(), 0.1F);
}

}  // namespace
