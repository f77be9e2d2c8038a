#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <regex>

#include "recipes/programs.h"
#include "support/json.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr char SYNC_ACTION[] = "/sys/block/md0/md/sync_action";
constexpr char UP_TO_DATE[] = " 0: cs:Connected ro:Primary/Secondary ds:UpToDate/UpToDate C r-----\n";

void writeProgram(const std::string& path, const std::string& text) {
    test::writeFile(path, text);
    ASSERT_EQ(chmod(path.c_str(), 0755), 0);
}

// Mount an empty directory of the node over one of /etc.
void makeEmpty(test::Machine& machine, const std::string& directory) {
    ASSERT_EQ(machine.node.run({"/bin/sh", "-c", "rm -rf " + directory + " && mkdir " + directory}).exitCode,
              0);
}

// Add a user and a group of the same number to the node.
void addUser(test::Machine& machine, const std::string& user, const std::string& group,
             const std::string& id) {
    const std::string entry = ':' + id + ':' + id + "::/:/bin/sh";
    ASSERT_EQ(
        machine.node
            .run({"/bin/sh", "-ec",
                  "sed -i '/^" + user + ":/d' /etc/passwd /etc/shadow; sed -i '/^" + group +
                      ":/d' /etc/group; echo '" + user + ":x" + entry + "' >>/etc/passwd; echo '" + group +
                      ":x:" + id + ":' >>/etc/group; echo '" + user + ":*:1::::::' >>/etc/shadow"})
            .exitCode,
        0);
}

class RecipesTest : public ::testing::Test {
 protected:
    RecipesTest() { test::installPrograms(); }
};

// Two nodes of the cluster, each with ternhad.
class Cluster {
 public:
    Cluster() {
        test::connect(a.node, a.address, b.node, b.address);
        a.write("/proc/drbd", UP_TO_DATE);
        b.write("/proc/drbd", UP_TO_DATE);
        b.start();
    }

    bool start(const std::vector<std::string>& options = {}) {
        a.start(options);
        return test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); });
    }

    bool eventuallyContains(const std::string& file, const std::string& text) {
        return test::eventually(60s, [&] {
            return test::exists(a.node.path(file)) &&
                   test::readFile(a.node.path(file)).find(text) != std::string::npos;
        });
    }

    test::Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    test::Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
};

TEST_F(RecipesTest, KeepalivedMovesTheAddressAndPromotesOnlyWhenSafe) {
    writeProgram("/usr/local/sbin/ternha-role.recipe", test::recipe("/usr/local/sbin/ternha-role"));
    writeProgram("/usr/local/sbin/ternha-role",
                 "#!/bin/sh\n/usr/local/sbin/ternha-role.recipe \"$@\"\necho \"$3 $?\" >>/tmp/role\n");
    writeProgram(
        "/usr/sbin/drbdadm",
        "#!/bin/sh\necho \"$*\" >>/tmp/drbdadm\n[ $1 = secondary ] || [ ! -e /tmp/peer-is-primary ]\n");
    Cluster cluster;
    test::Machine& a = cluster.a;
    a.write("/tmp/peer-is-primary", "");
    // The service network, whose only other member never replies.
    ASSERT_EQ(a.node.run({"ip", "link", "add", "eth0", "type", "veth", "peer", "name", "cable"}).exitCode, 0);
    for (const char* device : {"eth0", "cable"}) {
        ASSERT_EQ(a.node.run({"ip", "link", "set", device, "up"}).exitCode, 0);
    }
    ASSERT_EQ(a.node.run({"ip", "address", "add", "192.0.2.1/24", "dev", "eth0"}).exitCode, 0);
    makeEmpty(a, "/etc/keepalived");
    a.write("/etc/keepalived/keepalived.conf", test::recipe("/etc/keepalived/keepalived.conf"));
    ASSERT_TRUE(cluster.start());
    const auto hasAddress = [&a](bool expected) {
        return test::eventually(60s, [&] {
            const auto addresses = a.node.run({"ip", "address", "show", "eth0"}).output;
            return (addresses.find("192.0.2.10") != std::string::npos) == expected;
        });
    };

    test::Process keepalived = a.node.start({"keepalived", "--dont-fork", "--log-console", "--vrrp",
                                             "--pid=/run/k.pid", "--vrrp_pid=/run/v.pid"});
    EXPECT_TRUE(hasAddress(true)) << keepalived.output() << keepalived.error();
    // As in a planned failover, until the peer is secondary.
    EXPECT_TRUE(cluster.eventuallyContains("/tmp/drbdadm", "primary r0\nprimary r0\n"));
    test::removeTree(a.node.path("/tmp/peer-is-primary"));
    EXPECT_TRUE(cluster.eventuallyContains("/tmp/role", "MASTER 0\n"));

    a.write(SYNC_ACTION, "resync\n");
    EXPECT_TRUE(hasAddress(false));
    EXPECT_TRUE(cluster.eventuallyContains("/tmp/role", "FAULT 0\n"));
    EXPECT_THAT(test::readFile(a.node.path("/tmp/drbdadm")),
                ::testing::EndsWith("primary r0\nsecondary r0\n"));

    // DRBD is disconnected and the peer alive: it may be writing.
    a.write("/proc/drbd", " 0: cs:WFConnection ro:Secondary/Unknown ds:UpToDate/DUnknown C r-----\n");
    ASSERT_TRUE(test::eventually(20s, [&a] { return a.sees("isDRBDConnect", false); }));
    a.write(SYNC_ACTION, "idle\n");
    EXPECT_TRUE(hasAddress(true));
    const auto orders = [&a] { return test::lines(test::readFile(a.node.path("/tmp/drbdadm"))); };
    const auto promotions = [&] {
        const auto all = orders();
        return std::count(all.begin(), all.end(), "primary r0");
    };
    const auto before = promotions();
    EXPECT_TRUE(cluster.eventuallyContains("/run/ternha-role", "MASTER"));
    a.write(SYNC_ACTION, "resync\n");
    EXPECT_TRUE(hasAddress(false));
    EXPECT_TRUE(cluster.eventuallyContains("/tmp/role", "MASTER 1\n"));  // it tries no longer
    EXPECT_EQ(promotions(), before);

    // Once it is dead, this node may promote.
    cluster.b.daemon->signal(SIGKILL);
    ASSERT_TRUE(test::eventually(20s, [&a] { return a.sees("isRemoteAlive", false); }));
    a.write(SYNC_ACTION, "idle\n");
    EXPECT_TRUE(test::eventually(60s, [&] { return orders().back() == "primary r0"; }));
    keepalived.signal(SIGTERM);
    EXPECT_TRUE(keepalived.waitFor(20s).has_value());
}

class NrpeTest : public RecipesTest {
 protected:
    // Return the reply of the node's NRPE with this configuration of the check.
    static test::CommandResult ask(Cluster& cluster, const std::string& configuration) {
        test::Machine& a = cluster.a;
        a.write("/etc/hosts", "127.0.0.1 localhost node-a\n");
        makeEmpty(a, "/etc/nagios");
        a.write("/etc/nagios/nrpe.d/ternha.cfg", configuration);
        a.write("/etc/nagios/nrpe.cfg",
                "server_port=5666\nserver_address=127.0.0.1\nnrpe_user=nagios\nnrpe_group=nagios\n"
                "allowed_hosts=127.0.0.1\npid_file=/run/nrpe.pid\ninclude_dir=/etc/nagios/nrpe.d\n");
        test::Process nrpe = a.node.start({"nrpe", "-n", "-f", "-c", "/etc/nagios/nrpe.cfg"});
        test::CommandResult result;
        EXPECT_TRUE(test::eventually(30s,
                                     [&] {
                                         result = a.node.run({"/usr/lib/nagios/plugins/check_nrpe", "-n",
                                                              "-2", "-H", "127.0.0.1", "-c", "check_ternha"});
                                         return result.output.rfind("TERNHA", 0) == 0;
                                     }))
            << result.output << result.error << nrpe.error();
        nrpe.signal(SIGTERM);
        nrpe.waitFor(10s);
        return result;
    }
};

TEST_F(NrpeTest, SudoAllowsNagiosOnlyTheCheck) {
    Cluster cluster;
    test::Machine& a = cluster.a;
    addUser(a, "nagios", "nagios", "990");
    makeEmpty(a, "/etc/sudoers.d");
    a.write("/etc/sudoers", "root ALL=(ALL) ALL\n@includedir /etc/sudoers.d\n");
    a.write("/etc/sudoers.d/ternha", test::recipe("/etc/sudoers.d/ternha"));
    ASSERT_EQ(chmod(a.node.path("/etc/sudoers").c_str(), 0440), 0);
    ASSERT_EQ(chmod(a.node.path("/etc/sudoers.d/ternha").c_str(), 0440), 0);
    EXPECT_EQ(a.node.run({"visudo", "--check"}).exitCode, 0);
    const std::string configuration = test::recipe("/etc/nagios/nrpe.d/ternha.cfg");
    EXPECT_EQ(configuration, "command[check_ternha]=/usr/bin/sudo -n /usr/sbin/ternhactl check\n");
    const auto mayRun = [&a](const std::string& command) {
        return a.node.run({"/bin/sh", "-c", "sudo -l -U nagios " + command}).exitCode == 0;
    };
    EXPECT_TRUE(mayRun("/usr/sbin/ternhactl check"));
    EXPECT_FALSE(mayRun("/usr/sbin/ternhactl reboot-peer --yes"));
    EXPECT_FALSE(mayRun("/bin/sh"));
}

TEST_F(NrpeTest, RunsTheCheckOnTheStatusSocket) {
    Cluster cluster;
    test::Machine& a = cluster.a;
    addUser(a, "nagios", "nagios", "990");
    ASSERT_TRUE(cluster.start({"--status-socket", "/run/ternha/status.sock", "--status-group", "nagios"}));
    const std::string configuration = test::recipe("/etc/nagios/nrpe.d/ternha-status.cfg");
    const auto good = ask(cluster, configuration);
    EXPECT_EQ(good.exitCode, 0);
    EXPECT_THAT(good.output, StartsWith("TERNHA OK - peer alive"));

    a.daemon->signal(SIGTERM);
    a.daemon->waitFor(10s);
    const auto bad = ask(cluster, configuration);
    EXPECT_EQ(bad.exitCode, 3);
    EXPECT_THAT(bad.output, StartsWith("TERNHA UNKNOWN - ternhad does not answer"));
}

TEST_F(RecipesTest, PromtoolAcceptsMetricsAndRules) {
    Cluster cluster;
    ASSERT_TRUE(cluster.start());
    const auto metrics = cluster.a.node.run(
        {"/bin/sh", "-c",
         "ternhactl metrics --output /tmp/ternha.prom && promtool check metrics </tmp/ternha.prom"});
    EXPECT_EQ(metrics.exitCode, 0);
    EXPECT_EQ(metrics.output + metrics.error, "");

    std::filesystem::copy_file(PROJECT_DIR "/packaging/monitoring/ternha.rules.yml", "/tmp/ternha.rules.yml");
    std::filesystem::copy_file(RULES_TEST, "/tmp/ternha.rules.test.yml");
    for (const std::string mode :
         {"check rules /tmp/ternha.rules.yml", "test rules /tmp/ternha.rules.test.yml"}) {
        const auto result = test::run({"/bin/sh", "-c", "promtool " + mode});
        EXPECT_EQ(result.exitCode, 0) << result.output << result.error;
        EXPECT_THAT(result.output, HasSubstr("SUCCESS"));
    }
}

// The value of a setting in one of the package's units.
std::string setting(const std::string& unit, const std::string& name) {
    for (const std::string& line : test::lines(test::readFile(PROJECT_DIR "/packaging/systemd/" + unit))) {
        if (line.rfind(name + '=', 0) == 0) {
            return std::regex_replace(line.substr(name.size() + 1), std::regex("@[A-Z_]+@"), "/usr/sbin");
        }
    }
    return {};
}

TEST_F(RecipesTest, TheNodeExporterServesWhatTheTimersServiceWrites) {
    Cluster cluster;
    test::Machine& a = cluster.a;
    ASSERT_TRUE(cluster.start());
    ASSERT_EQ(a.node.run({"mkdir", "-p", "/var/lib/prometheus/node-exporter"}).exitCode, 0);
    // Debian's reads that directory unless told otherwise.
    test::Process exporter = a.node.start({"prometheus-node-exporter", "--web.listen-address=127.0.0.1:9100",
                                           "--collector.disable-defaults", "--collector.textfile"});
    const auto serves = [&a](const std::string& line) {
        return test::eventually(30s, [&] {
            const auto answer = a.node.run({"/bin/bash", "-c",
                                            "exec 3<>/dev/tcp/127.0.0.1/9100; printf 'GET /metrics "
                                            "HTTP/1.0\\r\\n\\r\\n' >&3; cat <&3"});
            return answer.output.find('\n' + line + '\n') != std::string::npos;
        });
    };
    const std::string service = setting("ternha-metrics.service.in", "ExecStart");
    ASSERT_THAT(service, StartsWith("/usr/sbin/ternhactl metrics "));
    EXPECT_EQ(a.node.run({"/bin/sh", "-c", service}).exitCode, 0);
    EXPECT_TRUE(serves("ternha_peer_alive 1")) << exporter.error();
    EXPECT_TRUE(serves("node_textfile_scrape_error 0"));
    a.daemon->signal(SIGKILL);
    EXPECT_EQ(a.node.run({"/bin/sh", "-c", service}).exitCode, 3);
    EXPECT_TRUE(serves("ternha_up 0"));
}

TEST_F(RecipesTest, TheDashboardShowsFiguresThatThereAre) {
    Cluster cluster;
    ASSERT_TRUE(cluster.start());
    const auto metrics = [&cluster] { return cluster.a.node.run({"ternhactl", "metrics"}).output; };
    EXPECT_TRUE(test::eventually(
        20s, [&] { return metrics().find("ternha_heartbeat_latency_seconds ") != std::string::npos; }));
    const std::string dashboard = test::readFile(PROJECT_DIR "/packaging/monitoring/ternha-dashboard.json");
    EXPECT_TRUE(test::parsed(dashboard)["panels"].isArray());
    const std::regex name("ternha_[a-z_]+");
    for (std::sregex_iterator match(dashboard.begin(), dashboard.end(), name), end; match != end; ++match) {
        EXPECT_THAT(metrics(), HasSubstr("# HELP " + match->str() + ' '));
    }
}

constexpr char COROSYNC[] = R"(totem {
    version: 2
    cluster_name: ternha
    transport: knet
    crypto_cipher: none
    crypto_hash: none
}
nodelist {
    node {
        ring0_addr: 127.0.0.1
        name: node-a
        nodeid: 1
    }
}
quorum {
    provider: corosync_votequorum
    expected_votes: 1
}
logging {
    to_stderr: yes
    to_syslog: no
}
system {
    allow_knet_handle_fallback: yes
    sched_rr: no
    move_to_root_cgroup: no
}
)";

TEST_F(RecipesTest, PacemakerLearnsWhetherTheNodeIsFit) {
    writeProgram("/usr/local/sbin/ternha-attribute", test::recipe("/usr/local/sbin/ternha-attribute"));
    Cluster cluster;
    test::Machine& a = cluster.a;
    addUser(a, "hacluster", "haclient", "991");
    makeEmpty(a, "/etc/corosync");
    a.write("/etc/corosync/corosync.conf", COROSYNC);
    ASSERT_EQ(
        a.node
            .run({"/bin/sh", "-ec",
                  "ln -s /run /var/run; mkdir -p /run/lock /run/crm /var/log/cluster /var/log/pacemaker "
                  "/var/lib/corosync /var/lib/pacemaker/cib /var/lib/pacemaker/pengine "
                  "/var/lib/pacemaker/cores /var/lib/pacemaker/blackbox; ln -s /run/lock /var/lock; "
                  "chown -R hacluster:haclient /run/crm /var/log/pacemaker /var/lib/pacemaker"})
            .exitCode,
        0);
    test::Process corosync = a.node.start({"corosync", "-f"});
    test::Process pacemaker = a.node.start({"/bin/sh", "-c", "PCMK_logfile=none exec pacemakerd -f"});
    const auto isUp = [&] {
        const auto result = a.node.run({"attrd_updater", "-n", "probe", "-U", "1"});
        return result.exitCode == 0;
    };
    ASSERT_TRUE(test::eventually(120s, isUp)) << corosync.error() << pacemaker.error();

    ASSERT_TRUE(cluster.start());
    test::Process attribute = a.node.start({"/usr/local/sbin/ternha-attribute"});
    const auto isFit = [&a](const std::string& value) {
        return test::eventually(60s, [&] {
            return a.node.run({"attrd_updater", "-n", "ternha-fit", "-Q"})
                       .output.find("value=\"" + value + '"') != std::string::npos;
        });
    };
    EXPECT_TRUE(isFit("1"));
    a.write(SYNC_ACTION, "resync\n");
    EXPECT_TRUE(isFit("0"));
    a.write(SYNC_ACTION, "idle\n");
    EXPECT_TRUE(isFit("1"));
    a.daemon->signal(SIGTERM);
    EXPECT_TRUE(isFit("0"));
    EXPECT_TRUE(attribute.waitFor(20s).has_value());  // and its service starts it again
    pacemaker.signal(SIGTERM);
    EXPECT_TRUE(pacemaker.waitFor(60s).has_value());
}

}  // namespace
