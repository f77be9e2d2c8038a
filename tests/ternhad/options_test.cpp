#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <ostream>

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

TEST_P(WrongUsageTest, IsExplainedBeforeAnythingIsOpened) {
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
        WrongUsage{"InfiniteInterval", plus({"--log-interval", "inf"}), "--log-interval: not in the range"},
        WrongUsage{"ShortDeadAfter", plus({"--dead-after", "0.1"}), "--dead-after: not in the range"},
        WrongUsage{"IntervalAboveAThirdOfDeadAfter", plus({"--check-interval", "1.1"}),
                   "--check-interval: above a third of --dead-after"},
        WrongUsage{"WordForInterval", plus({"--log-interval", "often"}), "--log-interval"},
        WrongUsage{"SmallRotateSize", plus({"--rotate-size", "1"}), "--rotate-size: "},
        WrongUsage{"Unknown", plus({"--frobnicate"}), "--frobnicate"},
        WrongUsage{"NoSuchConfiguration", plus({"--config", "/nowhere.conf"}), "/nowhere.conf"}),
    [](const auto& usage) { return usage.param.name; });

TEST_F(OptionsTest, AnUnknownKeyInTheConfigurationIsAnError) {
    test::writeFile("/tmp/ternhad.conf",
                    "local-ip = 127.0.0.1\nremote-ip = 127.0.0.2\ninterface = lo\nfrobnicate = 1\n");
    const auto result = ternhad({"--config", "/tmp/ternhad.conf"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_THAT(result.error, HasSubstr("frobnicate"));
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

TEST_F(OptionsTest, TheBroadcastAddressOfAnInterfaceIsNoPeer) {
    ASSERT_EQ(test::run({"ip", "link", "add", "eth1", "type", "veth", "peer", "name", "eth2"}).exitCode, 0);
    ASSERT_EQ(test::run({"ip", "address", "add", "10.5.0.1/24", "broadcast", "+", "dev", "eth1"}).exitCode,
              0);
    const auto result =
        ternhad({"--local-ip", "10.5.0.1", "--remote-ip", "10.5.0.255", "--interface", "eth1"});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_THAT(result.error, HasSubstr("--remote-ip: the broadcast address of a network: 10.5.0.255"));
}

TEST_F(OptionsTest, HelpAndVersionAreNoErrors) {
    const auto help = ternhad({"--help"});
    EXPECT_EQ(help.exitCode, 0);
    for (const char* option : {"--local-ip", "--remote-ip", "--interface", "--socket", "--check-interval",
                               "--dead-after", "--heartbeat-interval", "--log-interval",
                               "--snapshot-interval", "--rotate-size", "--config", "--version"}) {
        EXPECT_THAT(help.output, HasSubstr(option));
    }
    const auto version = ternhad({"--version"});
    EXPECT_EQ(version.exitCode, 0);
    EXPECT_EQ(version.output, "ternhad 6.2\n");
    EXPECT_FALSE(test::exists("/tmp/ha"));
}

}  // namespace
