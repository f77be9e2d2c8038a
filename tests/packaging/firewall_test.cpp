#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <csignal>
#include <optional>
#include <regex>

#include "support/node.h"
#include "support/udp.h"
#include "ternhad/daemon.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;

constexpr char CONFIG[] = "/tmp/ternhad.conf";
constexpr std::uint16_t PORT = 7499;

class GeneratorTest : public ::testing::Test {
 protected:
    static test::CommandResult generate(const std::string& config) {
        test::writeFile(CONFIG, config);
        return test::run({TERNHA_FIREWALL, "--config", CONFIG});
    }
};

TEST_F(GeneratorTest, AllowsThePeerOnly) {
    const auto result = generate("local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = eth1\n");
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_EQ(result.error, "");
    EXPECT_EQ(result.output,
              "table inet ternha\n"
              "delete table inet ternha\n"
              "table inet ternha {\n"
              "    chain input {\n"
              "        type filter hook input priority filter - 10; policy accept;\n"
              "        iifname \"eth1\" ip saddr 10.0.0.2 ip daddr 10.0.0.1 udp dport 7499 counter accept\n"
              "        udp dport 7499 counter drop\n"
              "    }\n"
              "}\n");
}

TEST_F(GeneratorTest, ReadsTheConfigurationAsTheDaemonDoes) {
    const auto plain = generate("local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = eth1\n");
    const auto other = generate(
        "# remote-ip = 10.9.9.9\n; interface = eth9\n\ncheck-interval = 0.5\n"
        "  interface=\"eth1\"\nremote-ip   =   10.0.0.2  \nlocal-ip='10.0.0.1'\n");
    EXPECT_EQ(other.exitCode, 0) << other.error;
    EXPECT_EQ(other.output, plain.output);
}

struct WrongConfiguration {
    const char* name;
    const char* text;
    const char* message;
};

void PrintTo(const WrongConfiguration& wrong, std::ostream* stream) {
    *stream << wrong.name;
}

class InvalidConfigurationTest : public GeneratorTest,
                                 public ::testing::WithParamInterface<WrongConfiguration> {};

TEST_P(InvalidConfigurationTest, IsRejectedWithoutRules) {
    const auto result = generate(GetParam().text);
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(result.error, std::string("ternha-firewall: /tmp/ternhad.conf: ") + GetParam().message + "\n");
}

INSTANTIATE_TEST_SUITE_P(
    Configurations, InvalidConfigurationTest,
    ::testing::Values(
        WrongConfiguration{"NoPeer", "local-ip = 10.0.0.1\ninterface = eth1\n", "remote-ip is missing"},
        WrongConfiguration{"NothingButComments", "#local-ip = 10.0.0.1\n", "local-ip is missing"},
        WrongConfiguration{"Network", "local-ip = 10.0.0.1\nremote-ip = 10.0.0.0/8\ninterface = eth1\n",
                           "remote-ip is wrong: 10.0.0.0/8"},
        WrongConfiguration{"BigOctet", "local-ip = 10.0.0.1\nremote-ip = 10.0.0.256\ninterface = eth1\n",
                           "remote-ip is wrong: 10.0.0.256"},
        WrongConfiguration{"LeadingZero", "local-ip = 10.0.0.1\nremote-ip = 10.0.0.02\ninterface = eth1\n",
                           "remote-ip is wrong: 10.0.0.02"},
        WrongConfiguration{
            "TwoPeers", "local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\nremote-ip = 10.0.0.3\ninterface = eth1\n",
            "remote-ip is wrong: 10.0.0.2\n10.0.0.3"},
        WrongConfiguration{"Injection",
                           "local-ip = 10.0.0.1\nremote-ip = 10.0.0.2\ninterface = x\" accept; iifname \"y\n",
                           "interface is wrong: x\" accept; iifname \"y"},
        WrongConfiguration{"SameAddress", "local-ip = 10.0.0.1\nremote-ip = 10.0.0.1\ninterface = eth1\n",
                           "remote-ip is the same address as local-ip"}),
    [](const auto& wrong) { return wrong.param.name; });

TEST_F(GeneratorTest, ReportsAnUnreadableConfiguration) {
    const auto result = test::run({TERNHA_FIREWALL, "--config", "/nowhere.conf"});
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(result.error, "ternha-firewall: cannot read /nowhere.conf\n");
}

// A node with a daemon, its peer on the replication link, and a third host on another link.
class FilterTest : public ::testing::Test {
 protected:
    FilterTest() {
        test::connect(node, "10.0.0.1", peer, "10.0.0.2");
        succeed(test::run({"ip", "link", "add", "eth2", "netns", std::to_string(node.pid()), "type", "veth",
                           "peer", "name", "eth2", "netns", std::to_string(third.pid())}));
        succeed(node.run({"ip", "address", "add", "10.0.1.1/24", "dev", "eth2"}));
        succeed(node.run({"ip", "link", "set", "eth2", "up"}));
        // The third host has its own address and that of the peer.
        succeed(third.run({"ip", "address", "add", "10.0.1.3/24", "dev", "eth2"}));
        succeed(third.run({"ip", "address", "add", "10.0.0.2/32", "dev", "eth2"}));
        succeed(third.run({"ip", "link", "set", "eth2", "up"}));
        succeed(third.run({"ip", "route", "add", "10.0.0.1/32", "dev", "eth2"}));
        // Only the rules may decide whether a forged sender reaches the daemon: disable the
        // kernel's source address checks and preset the neighbour.
        for (const char* interface : {"all", "eth2"}) {
            succeed(node.run(
                {"sh", "-c", std::string("echo 0 > /proc/sys/net/ipv4/conf/") + interface + "/rp_filter"}));
        }
        const auto link = node.run({"ip", "-o", "link", "show", "eth2"});
        std::smatch found;
        EXPECT_TRUE(std::regex_search(link.output, found, std::regex("link/ether ([0-9a-f:]+)")))
            << link.output;
        succeed(third.run({"ip", "neighbour", "replace", "10.0.0.1", "lladdr", found[1], "dev", "eth2"}));

        test::writeFile(node.path(CONFIG),
                        "local-ip = \"10.0.0.1\"\nremote-ip = 10.0.0.2\ninterface = eth1\n"
                        "check-interval = 0.2\n");
        startDaemon();
    }

    static void succeed(const test::CommandResult& result) { EXPECT_EQ(result.exitCode, 0) << result.error; }

    void startDaemon() {
        daemon.emplace(node.start({TERNHAD, "--config", CONFIG}));
        EXPECT_TRUE(test::eventually(10s, [this] {
            return !test::statusAt(node.path(test::CONTROL_SOCKET)).isNull();
        })) << daemon->error();
        EXPECT_TRUE(test::eventually(10s, [this] { return isAnswered(peer, "10.0.0.2"); }));
    }

    void firewall(const std::string& action) {
        succeed(node.run({TERNHA_FIREWALL, "--config", CONFIG, action}));
    }

    // Send a datagram to the daemon from an address of a host.
    static void send(test::Node& host, const std::string& sender, const std::string& text) {
        EXPECT_EQ(host.call([&] {
            test::UdpSocket(sender).send(text, "10.0.0.1", PORT);
            return 0;
        }),
                  0);
    }

    // Return whether the daemon replies to a host within a second.
    static bool isAnswered(test::Node& host, const std::string& sender) {
        return host.call([&] {
            test::UdpSocket socket(sender);
            socket.send("is_alive", "10.0.0.1", PORT);
            const auto reply = socket.receive(1s);
            return reply && reply->bytes == "alive" ? 0 : 1;
        }) == 0;
    }

    // An unknown request aborts the daemon if it arrives.
    bool isEnded(std::chrono::milliseconds deadline) {
        const auto status = daemon->waitFor(deadline);
        return status && WIFSIGNALED(*status) && WTERMSIG(*status) == SIGABRT;
    }

    std::string dropped() {
        const auto rules = node.run({"nft", "list", "table", "inet", "ternha"});
        std::smatch found;
        const std::regex counter("counter packets ([0-9]+) bytes [0-9]+ drop");
        return std::regex_search(rules.output, found, counter) ? found[1].str()
                                                               : "no rule in " + rules.output + rules.error;
    }

    bool haveDropped(const std::string& count) {
        return test::eventually(10s, [&] { return dropped() == count; });
    }

    test::Node node{"node-a"};
    test::Node peer{"node-b"};
    test::Node third{"third"};
    std::optional<test::Process> daemon;
};

TEST_F(FilterTest, ThirdHostReachesTheDaemonWithoutRules) {
    EXPECT_TRUE(isAnswered(third, "10.0.1.3"));
    send(third, "10.0.1.3", "nonsense");
    EXPECT_TRUE(isEnded(10s));
    startDaemon();
    send(third, "10.0.0.2", "nonsense");
    EXPECT_TRUE(isEnded(10s)) << "a forged sender";
}

TEST_F(FilterTest, RulesDropAThirdHostButNotThePeer) {
    firewall("--apply");
    EXPECT_FALSE(isAnswered(third, "10.0.1.3"));
    send(third, "10.0.1.3", "nonsense");
    send(third, "10.0.0.2", "nonsense");
    send(third, "10.0.0.2", "reboot_remote");
    EXPECT_TRUE(haveDropped("4")) << dropped();
    EXPECT_TRUE(isAnswered(peer, "10.0.0.2"));
    EXPECT_EQ(daemon->waitFor(0ms), std::nullopt);
    EXPECT_EQ(test::readFile(node.path("/proc/sysrq-trigger")), "");
}

TEST_F(FilterTest, RulesDropOtherHostsOnTheLinkAndTheNodeItself) {
    firewall("--apply");
    succeed(peer.run({"ip", "address", "add", "10.0.0.3/24", "dev", "eth1"}));
    send(peer, "10.0.0.3", "nonsense");
    send(node, "10.0.0.1", "nonsense");
    EXPECT_TRUE(haveDropped("2")) << dropped();
    EXPECT_TRUE(isAnswered(peer, "10.0.0.2"));
}

TEST_F(FilterTest, RulesAreReplacedAtomicallyAndRemoved) {
    firewall("--remove");
    firewall("--apply");
    firewall("--apply");
    const auto rules = node.run({"nft", "list", "table", "inet", "ternha"}).output;
    EXPECT_EQ(rules.find("drop"), rules.rfind("drop")) << rules;
    EXPECT_FALSE(isAnswered(third, "10.0.1.3"));
    firewall("--remove");
    EXPECT_EQ(node.run({"nft", "list", "ruleset"}).output, "");
    EXPECT_TRUE(isAnswered(third, "10.0.1.3"));
}

TEST_F(FilterTest, RulesAreKeptWhenTheConfigurationIsInvalid) {
    firewall("--apply");
    test::writeFile(node.path(CONFIG), "local-ip = 10.0.0.1\ninterface = eth1\n");
    const auto result = node.run({TERNHA_FIREWALL, "--config", CONFIG, "--apply"});
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_THAT(result.error, HasSubstr("remote-ip is missing"));
    EXPECT_FALSE(isAnswered(third, "10.0.1.3"));
    EXPECT_TRUE(isAnswered(peer, "10.0.0.2"));
}

}  // namespace
