"""The scenes of the service, from installation to purge."""

import re
import socket

import service
from checks import Checks
from containers import THIRD_HOST, Containers
from node import Node
from service_scenes import RETURN_LIMIT, WATCHDOG, hung_thread, kill, reload, stop, unknown_request, upgrade

PORT = 7499
ALIVE = {"isRemoteAlive": True}
# Containers have none of these.
ABSENT = ("/proc/drbd", "/sys/block/md*", "/sys/class/ata_port/ata*")
PRIVATE_PROC = "BindPaths=/run/proc:/proc"
FIREWALL = "nft list chain inet ternha input"


def run(pair: Containers, checks: Checks):
    install(pair, checks)
    start(pair, checks)
    sandbox(pair, checks)
    firewall(pair, checks)
    kill(pair, checks, ALIVE)
    unknown_request(pair, checks, ALIVE)
    private_proc(pair.b, "mkfifo drbd")
    service.override(pair.b, WATCHDOG, PRIVATE_PROC)
    hung_thread(pair, checks, ALIVE, lambda: service.override(pair.b))
    reload(pair, checks)
    reboot_trigger(pair, checks)
    stop(pair, checks, ALIVE)
    wrong_options(pair, checks)
    upgrade(pair, checks, ALIVE, "apt-get install --quiet --yes /packages/new/*.deb")
    remove(pair, checks)


def install(pair: Containers, checks: Checks):
    checks.scene("apt installs packages of the previous version")
    pair.run("apt-get install --quiet --yes /packages/old/*.deb", 120)
    checks.equal("nothing is enabled", ["disabled\ndisabled\n"] * 2,
                 pair.run("systemctl is-enabled ternhad ternha-firewall || true"))
    checks.equal("nothing has started", ["inactive"] * 2, [service.state(node) for node in pair.nodes])
    pair.run("! pidof ternhad && ! systemctl is-active --quiet ternha-firewall")
    checks.that("without addresses the daemon does not start", pair.a.try_run("systemctl start ternhad")[0] != 0,
                "a failure", "success")
    checks.equal("and logs the reason", 1, pair.a.run("journalctl --unit=ternhad | grep -c 'local-ip'").count("\n"))
    pair.a.run("systemctl reset-failed ternhad")


def start(pair: Containers, checks: Checks):
    checks.scene("Configured and enabled, both nodes detect each other")
    for node, peer in (pair.nodes, pair.nodes[::-1]):
        service.configure(node, peer, "eth1")
    pair.run("systemctl enable --quiet --now ternha-firewall ternhad")
    checks.equal("enable --now returns when the daemons are ready", ["active"] * 2,
                 [service.state(node) for node in pair.nodes])
    checks.equal("the watchdog is active", ["notify"] * 2, [service.properties(node, "Type")[0] for node in pair.nodes])
    checks.within(RETURN_LIMIT, "both report alive", pair.statuses, [ALIVE] * 2)


def sandbox(pair: Containers, checks: Checks):
    checks.scene("Inside the service's sandbox")

    def is_measured(record):
        """a heartbeat latency above 0 ms, a non-OK rate of 0"""
        return record.get("heartbeatLatency", 0) > 0 and record["heartbeatPacketFailRate"] == 0

    checks.within(RETURN_LIMIT, "ping and ifconfig: heartbeat latency above 0, non-OK rate 0", pair.a.status,
                  is_measured)

    def is_recorded(text):
        """ternhad and init among the processes, / among the file systems, the size of the memory"""
        parts = (r"^ *1 .*(systemd|init)", r"^ *\d+ .*ternhad --config", r"^overlay .*% /$", r"^MemTotal: +\d+ kB$")
        return all(re.search(part, text, re.MULTILINE) for part in parts)

    record = "cat /var/log/ha/ha.daemon.record /tmp/ha/ha.daemon.record 2>/dev/null || true"
    checks.within(RETURN_LIMIT, "ps and df: recorded at the start", lambda: pair.a.run(record), is_recorded)
    failures = [line for line in pair.a.full_log() if "Failed" in line and not line.endswith(ABSENT)]
    checks.equal("no failures", [], failures)


def firewall(pair: Containers, checks: Checks):
    checks.scene("The firewall admits only the peer")
    third = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    third.bind((THIRD_HOST, 0))
    third.settimeout(0.2)

    def ask() -> bool:
        third.sendto(b"is_alive", (pair.b.address, PORT))
        try:
            return bool(third.recv(64))
        except TimeoutError:
            return False

    dropped, accepted = packets(pair.b, "drop"), packets(pair.b, "accept")
    checks.equal("a third host gets no reply", False, ask())
    checks.within(RETURN_LIMIT, "its datagram was dropped", lambda: packets(pair.b, "drop") > dropped, True)
    checks.within(RETURN_LIMIT, "the peer's datagrams are accepted", lambda: packets(pair.b, "accept") > accepted, True)
    pair.b.run("systemctl stop ternha-firewall")
    checks.within(RETURN_LIMIT, "without the firewall it gets one", ask, True)
    pair.b.run("systemctl start ternha-firewall")
    checks.equal("with it, none", False, ask())
    checks.equal("both report alive", [True] * 2, [record["isRemoteAlive"] for record in pair.statuses()])


def packets(node: Node, verdict: str) -> int:
    found = re.search(rf"packets (\d+) bytes \d+ {verdict}", node.run(FIREWALL))
    return int(found.group(1)) if found else -1


def private_proc(node: Node, command: str):
    """Create the directory that PRIVATE_PROC binds over the service's /proc.

    It has links to the kernel's files that the service needs, and what `command` creates.
    """
    node.run(
        "mkdir -p /run/kernel-proc && mount --bind /proc /run/kernel-proc && rm -rf /run/proc && mkdir /run/proc"
        " && cd /run/proc && for file in self meminfo mounts net stat sys uptime; do"
        f" ln -s /run/kernel-proc/$file .; done && {command}"
    )


def reboot_trigger(pair: Containers, checks: Checks):
    checks.scene("node-a requests a reboot of node-b")
    private_proc(pair.b, "touch sysrq-trigger")
    service.override(pair.b, PRIVATE_PROC)
    pair.b.run("systemctl restart ternhad")
    checks.within(RETURN_LIMIT, "both report alive", pair.statuses, [ALIVE] * 2)
    request = pair.a.channel.start("ternhactl reboot-peer --yes")
    checks.within(RETURN_LIMIT, "node-b has written to the trigger",
                  lambda: pair.b.run("cat /run/proc/sysrq-trigger").strip(), "b")
    request.kill()
    service.override(pair.b)
    pair.run("systemctl restart ternhad")
    checks.within(RETURN_LIMIT, "both report alive", pair.statuses, [ALIVE] * 2)


def wrong_options(pair: Containers, checks: Checks):
    checks.scene("Wrong options are not retried")
    before = service.restarts(pair.b)
    pair.b.run(f"cp {service.FILE} /run/right && sed -i 's/^remote-ip = .*/remote-ip = somewhere/' {service.FILE}")
    checks.that("the restart fails", pair.b.try_run("systemctl restart ternhad")[0] != 0, "a failure", "success")
    checks.equal("with exit code 2", ["failed", "2"], service.properties(pair.b, "ActiveState", "ExecMainStatus"))
    checks.that("the journal names the wrong value", "somewhere" in pair.b.run("journalctl --unit=ternhad"),
                "somewhere", "no such line")
    checks.holds(3, "it stays failed", lambda: (service.state(pair.b), service.restarts(pair.b)), ("failed", before))
    pair.b.run(f"cp /run/right {service.FILE} && systemctl start ternhad")
    checks.within(RETURN_LIMIT, "with correct options both report alive", pair.statuses, [ALIVE] * 2)


def remove(pair: Containers, checks: Checks):
    checks.scene("apt removes and purges the packages of node-b")
    packages = " ".join(service.PACKAGES)
    pair.b.run(f"apt-get remove --quiet --yes {packages}", 120)
    checks.equal("neither the daemon nor its programs are left", "gone\n",
                 pair.b.run("pidof ternhad || which ternhad || echo gone"))
    checks.equal("the firewall's rules are gone", 1, pair.b.try_run(FIREWALL)[0])
    checks.equal("configuration and logs are left", 0,
                 pair.b.try_run(f"test -f {service.FILE} && test -s /var/log/ha/ha.daemon.log")[0])
    checks.within(RETURN_LIMIT, "node-a reports dead", pair.a.status, {"isRemoteAlive": False})
    pair.b.run(f"apt-get purge --quiet --yes {packages}", 120)
    left = pair.b.run("find / -xdev \\( -iname '*ternha*' -o -path '/var/log/ha*' -o -path '/tmp/ha*' \\)"
                      " -not -path '/var/log/apt/*' -not -path '/packages*' -not -path '/run/*'")
    checks.equal("purged, nothing is left", "", left)
