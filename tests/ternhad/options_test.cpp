#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <ostream>
#include <regex>

#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

// Without the directories of the log: whether the daemon makes them is the question.
class OptionsTest : public ::testing::Test {
 protected:
    static test::CommandResult ternhad(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), TERNHAD);
        return test::run(arguments);
    }
};

struct WrongUsage {
    const char* name;
    std::vector<std::string> arguments;
    const char* message;
};

void PrintTo(const WrongUsage& usage, std::ostream* stream) {
    *stream << usage.name;
}

class WrongUsageTest : public OptionsTest, public ::testing::WithParamInterface<WrongUsage> {};

TEST_P(WrongUsageTest, IsReportedBeforeAnythingIsOpened) {
    const auto result = ternhad(GetParam().arguments);
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_THAT(result.error, HasSubstr(GetParam().message));
    EXPECT_FALSE(test::exists("/tmp/ha"));
    EXPECT_FALSE(test::exists("/var/log/ha"));
    EXPECT_FALSE(test::exists("/run/ternha"));
}

std::vector<std::string> plus(const std::vector<std::string>& more) {
    std::vector<std::string> all = {"--local-ip", "127.0.0.1",   "--remote-ip",
                                    "127.0.0.2",  "--interface", "lo"};
    all.insert(all.end(), more.begin(), more.end());
    return all;
}

INSTANTIATE_TEST_SUITE_P(
    Usages, WrongUsageTest,
    ::testing::Values(
        WrongUsage{"Nothing", {}, "--local-ip is required"},
        WrongUsage{"NoInterface",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.2"},
                   "--interface is required"},
        WrongUsage{"BadAddress",
                   {"--local-ip", "127.0.0.300", "--remote-ip", "127.0.0.2", "--interface", "lo"},
                   "--local-ip: "},
        WrongUsage{"AddressWithALeadingZero",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.02", "--interface", "lo"},
                   "--remote-ip: not an IPv4 address: 127.0.0.02"},
        WrongUsage{"AnyAddress",
                   {"--local-ip", "0.0.0.0", "--remote-ip", "127.0.0.2", "--interface", "lo"},
                   "--local-ip: not the address of one node: 0.0.0.0"},
        WrongUsage{"MulticastAddress",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "224.0.0.18", "--interface", "lo"},
                   "--remote-ip: not the address of one node: 224.0.0.18"},
        WrongUsage{"BroadcastAddress",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "255.255.255.255", "--interface", "lo"},
                   "--remote-ip: not the address of one node: 255.255.255.255"},
        WrongUsage{"AnyAddressOfThePeer",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "0.0.0.0", "--interface", "lo"},
                   "--remote-ip: not the address of one node: 0.0.0.0"},
        WrongUsage{"OwnMulticastAddress",
                   {"--local-ip", "239.255.255.255", "--remote-ip", "127.0.0.2", "--interface", "lo"},
                   "--local-ip: not the address of one node: 239.255.255.255"},
        WrongUsage{"OwnBroadcastAddress",
                   {"--local-ip", "255.255.255.255", "--remote-ip", "127.0.0.2", "--interface", "lo"},
                   "--local-ip: not the address of one node: 255.255.255.255"},
        WrongUsage{"NoAddress",
                   {"--local-ip", "", "--remote-ip", "127.0.0.2", "--interface", "lo"},
                   "--local-ip: not an IPv4 address: "},
        WrongUsage{"InterfaceWithAControlCharacter",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.2", "--interface", "l\x1bo"},
                   "--interface: not the name of a network interface: l?o"},
        WrongUsage{"SameAddresses",
                   {"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.1", "--interface", "lo"},
                   "--remote-ip: the same address as --local-ip"},
        WrongUsage{
            "LongInterface",
            {"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.2", "--interface", "a-name-of-sixteen"},
            "--interface: not the name of a network interface"},
        WrongUsage{"RelativeSocket", plus({"--socket", "control.sock"}), "--socket: not an absolute path"},
        WrongUsage{"LongSocket", plus({"--socket", "/" + std::string(107, 'x')}),
                   "--socket: longer than 107 characters"},
        WrongUsage{"NoInterval", plus({"--check-interval", "0"}), "--check-interval: not in the range"},
        WrongUsage{"IntervalThatIsNoNumber", plus({"--check-interval", "nan"}), "--check-interval: not in"},
        WrongUsage{"DeadAfterThatIsNoNumber", plus({"--dead-after", "-nan"}), "--dead-after: not in"},
        WrongUsage{"HeartbeatThatIsNoNumber", plus({"--heartbeat-interval", "nan"}),
                   "--heartbeat-interval: not in"},
        WrongUsage{"SnapshotsThatAreNoNumber", plus({"--snapshot-interval", "NaN"}),
                   "--snapshot-interval: not in"},
        WrongUsage{"LogsThatAreNoNumber", plus({"--log-interval", "nan"}), "--log-interval: not in"},
        WrongUsage{"InfiniteInterval", plus({"--log-interval", "inf"}), "--log-interval: not in the range"},
        WrongUsage{"InfiniteDeadAfter", plus({"--dead-after", "infinity"}), "--dead-after: not in the range"},
        WrongUsage{"IntervalBeyondAllNumbers", plus({"--snapshot-interval", "1e400"}),
                   "--snapshot-interval: not in the range"},
        WrongUsage{"RotateSizeThatIsNoNumber", plus({"--rotate-size", "nan"}), "--rotate-size: "},
        WrongUsage{"ShortDeadAfter", plus({"--dead-after", "0.1"}), "--dead-after: not in the range"},
        WrongUsage{"IntervalAboveAThirdOfDeadAfter", plus({"--check-interval", "1.1"}),
                   "--check-interval: above a third of --dead-after"},
        WrongUsage{"WordForInterval", plus({"--log-interval", "often"}), "--log-interval"},
        WrongUsage{"SmallRotateSize", plus({"--rotate-size", "1"}), "--rotate-size: "},
        WrongUsage{"LargeRotateSize", plus({"--rotate-size", "1099511627777"}), "--rotate-size: "},
        WrongUsage{"Unknown", plus({"--frobnicate"}), "--frobnicate"},
        WrongUsage{"NoSuchConfiguration", plus({"--config", "/nowhere.conf"}), "/nowhere.conf"}),
    [](const auto& usage) { return usage.param.name; });

TEST_F(OptionsTest, UnknownNameInTheConfigurationIsAnError) {
    test::writeFile("/tmp/ternhad.conf",
                    "local-ip = 127.0.0.1\nremote-ip = 127.0.0.2\ninterface = lo\nfrobnicate = 1\n");
    const auto result = ternhad({"--config", "/tmp/ternhad.conf"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_EQ(result.error, "ternhad: /tmp/ternhad.conf:4: unknown name: frobnicate\n");
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

struct WrongLine {
    const char* name;
    const char* line;
    const char* message;
};

void PrintTo(const WrongLine& line, std::ostream* stream) {
    *stream << line.name;
}

class WrongLineTest : public OptionsTest, public ::testing::WithParamInterface<WrongLine> {};

TEST_P(WrongLineTest, IsNamedWithItsFileAndNumber) {
    test::writeFile("/tmp/ternhad.conf", std::string("# Comment\nlocal-ip = 127.0.0.1\ninterface = lo\n\n") +
                                             GetParam().line + '\n');
    const auto result =
        ternhad({"--config", "/tmp/ternhad.conf", "--remote-ip", "127.0.0.2", "--check-config"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_EQ(result.error, std::string("ternhad: /tmp/ternhad.conf:5: ") + GetParam().message + '\n');
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

INSTANTIATE_TEST_SUITE_P(
    Lines, WrongLineTest,
    ::testing::Values(
        WrongLine{"Value", "check-interval = 0", "check-interval = 0: not in the range from 0.05 to 86400"},
        WrongLine{"Word", "log-interval = often",
                  "log-interval = often: Could not convert: --log-interval = often"},
        WrongLine{"Path", "socket = here", "socket = here: not an absolute path: here"},
        WrongLine{"Pair", "dead-after = 2",
                  "dead-after = 2: --check-interval: above a third of --dead-after"},
        WrongLine{"Comment", "dead-after = 3 # comment",
                  "a comment needs a line of its own: dead-after = 3 # comment"},
        WrongLine{"OtherComment", "dead-after = 3 ; comment",
                  "a comment needs a line of its own: dead-after = 3 ; comment"},
        WrongLine{"CommentAfterATab", "dead-after = 3\t#",
                  "a comment needs a line of its own: dead-after = 3\t#"},
        WrongLine{"Blanks", "notify = /bin/true now",
                  "a value with blanks needs quotes: notify = /bin/true now"},
        WrongLine{"NoValue", "rotate-size", "not NAME = VALUE: rotate-size"},
        WrongLine{"Section", "[daemon]", "not NAME = VALUE: [daemon]"},
        WrongLine{"Twice", "interface = eth1", "interface stands in line 3 already"},
        WrongLine{"OnlyForTheCommandLine", "check-config = true", "unknown name: check-config"},
        WrongLine{"Program", "notify = /nowhere", "notify = /nowhere: /nowhere: No such file or directory"},
        WrongLine{"NoProgram", "notify = /tmp/ternhad.conf",
                  "notify = /tmp/ternhad.conf: not an executable file: /tmp/ternhad.conf"},
        WrongLine{"SocketOfNobody", "status-socket = /run/x",
                  "status-socket = /run/x: needs --status-group"}),
    [](const auto& line) { return line.param.name; });

TEST_F(OptionsTest, EqualAddressesAreReportedAtThePeers) {
    const auto messageOf = [](const std::string& addresses) {
        test::writeFile("/tmp/ternhad.conf", "interface = lo\n" + addresses);
        return ternhad({"--config", "/tmp/ternhad.conf"}).error;
    };
    EXPECT_EQ(messageOf("local-ip = 127.0.0.1\nremote-ip = 127.0.0.1\n"),
              "ternhad: /tmp/ternhad.conf:3: remote-ip = 127.0.0.1: the same address as --local-ip\n");
    EXPECT_EQ(messageOf("remote-ip = 127.0.0.1\nlocal-ip = 127.0.0.1\n"),
              "ternhad: /tmp/ternhad.conf:2: remote-ip = 127.0.0.1: the same address as --local-ip\n");
}

TEST_F(OptionsTest, ByteOrderMarkIsNamed) {
    test::writeFile("/tmp/ternhad.conf", "\xEF\xBB\xBFlocal-ip = 127.0.0.1\n");
    const auto result = ternhad({"--config", "/tmp/ternhad.conf"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_EQ(result.error,
              "ternhad: /tmp/ternhad.conf:1: the file begins with a byte order mark: save it without one\n");
}

TEST_F(OptionsTest, UnreadableOrIncompleteFileIsNamed) {
    test::writeFile("/tmp/ternhad.conf", "local-ip = 127.0.0.1\nremote-ip = 127.0.0.2\n");
    const auto messageOn = [](const std::string& file) {
        const auto result = ternhad({"--config", file});
        EXPECT_EQ(result.exitCode, 2);
        return result.error;
    };
    EXPECT_EQ(messageOn("/tmp/ternhad.conf"), "ternhad: /tmp/ternhad.conf: --interface is required\n");
    EXPECT_EQ(messageOn("/nowhere.conf"), "ternhad: /nowhere.conf: No such file or directory\n");
    EXPECT_EQ(messageOn("/tmp"), "ternhad: /tmp: Is a directory\n");
    EXPECT_EQ(messageOn("/tmp/ternhad.conf/x"), "ternhad: /tmp/ternhad.conf/x: Not a directory\n");
}

TEST_F(OptionsTest, CommandLineErrorsDoNotNameTheFile) {
    test::writeFile("/tmp/ternhad.conf", "local-ip = 127.0.0.1\nremote-ip = 127.0.0.2\ninterface = lo\n");
    const auto result = ternhad({"--config", "/tmp/ternhad.conf", "--local-ip", "127.0.0.300"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_THAT(result.error, StartsWith("--local-ip: not an IPv4 address: 127.0.0.300\n"));
}

TEST_F(OptionsTest, CheckConfigChecksWithoutStarting) {
    test::writeFile("/tmp/notify", "#!/bin/sh\n");
    ASSERT_EQ(chmod("/tmp/notify", 0777), 0);
    test::writeFile("/tmp/ternhad.conf",
                    "local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = eth9\ndead-after = 6\n"
                    "notify = /tmp/notify\nstatus-socket = /run/ternha/status.sock\nstatus-group = daemon\n");
    const auto result = ternhad({"--config", "/tmp/ternhad.conf", "--check-config", "--interface", "lo"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_EQ(result.output,
              "local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = lo\nsocket = /run/ternha/control.sock\n"
              "check-interval = 1\ndead-after = 6\nheartbeat-interval = 10\nlog-interval = 10\n"
              "snapshot-interval = 3600\nrotate-size = 1048576\nnotify = /tmp/notify\n"
              "status-socket = /run/ternha/status.sock\nstatus-group = daemon\n");
    EXPECT_EQ(result.error,
              "ternhad: interface lo does not have the address 10.0.0.1\n"
              "ternhad: notify program /tmp/notify can be changed by others than root\n");
    EXPECT_THAT(ternhad({"--config", "/tmp/ternhad.conf", "--check-config"}).error,
                HasSubstr("there is no network interface eth9 (yet): its packet rate is unknown\n"));
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

// The daemon itself, which starts next, says the rest.
TEST_F(OptionsTest, ServiceLogsTheValuesInEffectBeforeTheStartAndNothingElse) {
    const std::string unit = test::readFile(SERVICE_UNIT);
    const std::string key = "\nExecStartPre=-";
    const std::size_t begin = unit.find(key) + key.size();
    std::string command = unit.substr(begin, unit.find('\n', begin) - begin);
    command = std::regex_replace(command, std::regex("@CMAKE_INSTALL_FULL_SBINDIR@/ternhad"), TERNHAD);
    command = std::regex_replace(command, std::regex("@TERNHA_CONFIG_FILE@"), "/tmp/ternhad.conf");
    for (const std::string interface : {"eth9", "this is no interface"}) {
        test::writeFile("/tmp/ternhad.conf",
                        "local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = " + interface + '\n');
        const auto result = test::run({"/bin/sh", "-c", command});
        EXPECT_EQ(result.error, "");
        EXPECT_EQ(result.output.find("interface = eth9\n") != std::string::npos, interface == "eth9");
    }
}

TEST_F(OptionsTest, BroadcastAddressOfAnInterfaceIsRefused) {
    ASSERT_EQ(test::run({"ip", "link", "add", "eth1", "type", "veth", "peer", "name", "eth2"}).exitCode, 0);
    ASSERT_EQ(test::run({"ip", "address", "add", "10.5.0.1/24", "broadcast", "+", "dev", "eth1"}).exitCode,
              0);
    const auto peer = ternhad({"--local-ip", "10.5.0.1", "--remote-ip", "10.5.0.255", "--interface", "eth1"});
    EXPECT_EQ(peer.exitCode, 2);
    EXPECT_THAT(peer.error, HasSubstr("--remote-ip: the broadcast address of a network: 10.5.0.255"));
    const auto own = ternhad({"--local-ip", "10.5.0.255", "--remote-ip", "10.5.0.2", "--interface", "eth1"});
    EXPECT_EQ(own.exitCode, 2);
    EXPECT_THAT(own.error, HasSubstr("--local-ip: the broadcast address of a network: 10.5.0.255"));
}

TEST_F(OptionsTest, OtherEndOfAPointToPointLinkIsAccepted) {
    ASSERT_EQ(test::run({"ip", "link", "add", "eth1", "type", "veth", "peer", "name", "eth2"}).exitCode, 0);
    ASSERT_EQ(test::run({"ip", "address", "add", "10.5.0.1", "peer", "10.5.0.2", "dev", "eth1"}).exitCode, 0);
    EXPECT_EQ(ternhad({"--local-ip", "10.5.0.1", "--remote-ip", "10.5.0.2", "--interface", "eth1",
                       "--check-config"})
                  .exitCode,
              0);
}

TEST_F(OptionsTest, OutputErrorsAreReported) {
    for (const std::string arguments :
         {"--help", "--version",
          "--local-ip 127.0.0.1 --remote-ip 127.0.0.2 --interface lo --check-config"}) {
        const auto result = test::run({"/bin/sh", "-c", TERNHAD " " + arguments + " >/dev/full"});
        EXPECT_EQ(result.exitCode, 1) << arguments;
        EXPECT_EQ(result.error, "ternhad: cannot write to standard output: No space left on device\n");
    }
}

TEST_F(OptionsTest, StatusSocketIsNotTheControlSocketByAnotherName) {
    const auto result =
        ternhad({"--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.2", "--interface", "lo", "--status-group",
                 "daemon", "--status-socket", "/run/ternha/../ternha/control.sock"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_THAT(result.error, HasSubstr("the same path as --socket"));
}

TEST_F(OptionsTest, HelpAndVersionSucceed) {
    const auto help = ternhad({"--help"});
    EXPECT_EQ(help.exitCode, 0);
    for (const char* option :
         {"--local-ip ADDRESS", "--remote-ip ADDRESS", "--interface", "--socket", "--check-interval",
          "--dead-after", "--heartbeat-interval", "--log-interval", "--snapshot-interval", "--rotate-size",
          "--notify", "--status-socket", "--status-group", "--check-config", "--config", "--version"}) {
        EXPECT_THAT(help.output, HasSubstr(option));
    }
    const auto version = ternhad({"--version"});
    EXPECT_EQ(version.exitCode, 0);
    EXPECT_EQ(version.output, "ternhad 6.2\n");
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

}  // namespace
