"""The scenario of the lab, from installation to measurement."""

import re
import time

import service
from checks import Checks
from lab import Lab
from log_scenes import (
    fill_disk, free_disk, lose_power, reboot_peer, return_after_reboot, return_after_power_loss, rotate_log,
)
from node import Node
from pair_state import (
    APART, CUT_LIMIT, DEAD, DEAD_LIMIT, MIRROR, RAISE_DEAD_AFTER, RETURN_LIMIT, SOME_ROUNDS, START_WRITER, STOP_WRITER,
    WELL, count_disconnects, drbd_received, drbd_states,
)
from service_scenes import WATCHDOG, hung_thread, unknown_request, upgrade
from storage_scenes import initial_sync, md_actions, split_brain

LONGER_THAN_DEAD_AFTER = 4  # seconds
IDLE = 10  # seconds over which processor use is measured: the longest default interval
IDLE_LIMIT = 1200  # CPU seconds per hour on an emulated processor; a thread that never sleeps uses 3600
INTERVALS = {  # suitable for an emulated machine on a busy host; the scenario moves the logs itself
    "check-interval": 0.5,
    "heartbeat-interval": 2,
    "log-interval": 600,
}
MOUNT_PACKAGES = (
    "mkdir -p /packages && { mountpoint -q /packages || mount -o ro /dev/disk/by-id/virtio-packages /packages; }"
)
FIFO = "/run/drbd.fifo"
THIRD_HOST = "10.11.0.9"
SEND_AS_THIRD_HOST = (
    "perl -MIO::Socket::INET -e 'IO::Socket::INET->new(Proto => \"udp\", LocalAddr => \"" + THIRD_HOST + "\","
    " PeerAddr => \"%s:7499\")->send(\"no_such_request\") or die'"
)
GROUP = "/sys/fs/cgroup/system.slice/ternhad.service"


def run(lab: Lab, checks: Checks):
    install(lab, checks)
    find_each_other(lab, checks)
    initial_sync(lab, checks)
    cut_link(lab, checks)
    md_actions(lab, checks)
    split_brain(lab, checks)
    kill_daemon(lab, checks)
    freeze_node(lab, checks)
    step_clock(lab, checks)
    # node-b boots twice; meanwhile scenes of node-a alone.
    power_loss = lose_power(lab, checks)
    rotate_log(lab, checks)
    full_disk = fill_disk(lab, checks)
    return_after_power_loss(lab, checks, power_loss)
    prepare_next_boot(lab.b)
    reboot = reboot_peer(lab, checks)
    free_disk(lab, checks, full_disk)
    return_after_reboot(lab, checks, reboot)
    raise_dead_after(lab, checks)
    unknown_request(lab, checks, WELL)
    lab.b.run(f"mkfifo {FIFO}")
    hung_thread(lab, checks, WELL, lambda: lab.b.run(f"rm {FIFO}"))
    upgrade_while_replicating(lab, checks)
    begin, use = time.monotonic(), processor_use(lab)
    firewall(lab, checks)
    measure(lab, checks, begin, use)


def install(lab: Lab, checks: Checks):
    checks.scene("Both nodes boot, dpkg installs the packages")
    checks.equal("both run a 32-bit ARM kernel", ["armv7l\n"] * 2, lab.run("uname -m"))
    checks.equal("and systemd", ["systemd\n"] * 2, lab.run("cat /proc/1/comm"))
    # For kill_daemon(); until the next boot.
    service.prepare_override(lab.b, service.DROP_IN, "Restart=no")
    lab.run(f"{MOUNT_PACKAGES} && cp /packages/ternha-lab-tool /usr/local/bin && dpkg --install /packages/old/*.deb")
    for node, peer in (lab.nodes, lab.nodes[::-1]):
        service.configure(node, peer, "eth0", **INTERVALS)
    lab.run(
        "drbdadm --force create-md r0 && drbdadm up r0 && mdadm --create /dev/md0 --run --assume-clean --quiet"
        f" --level=1 --raid-devices=2 --metadata=1.2 {MIRROR}"
    )
    checks.within(RETURN_LIMIT, "DRBD is Connected on both", lambda: drbd_states(lab), ["Connected"] * 2)


def find_each_other(lab: Lab, checks: Checks):
    checks.scene("The service is enabled, both nodes detect each other")
    lab.run("systemctl enable --quiet --now ternha-firewall ternhad")
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
    checks.fact(f"{checks.elapsed():.0f} s after the machines were switched on")
    check_tools(lab, checks)
    checks.within(
        RETURN_LIMIT,
        "both have logged the other's hostname",
        lambda: [
            lab.a.has_logged(" Remote hostname is node-b"),
            lab.b.has_logged(" Remote hostname is node-a"),
        ],
        [True] * 2,
    )

    def is_measured(records):
        """a heartbeat latency above 0 and below 1000 ms, a non-OK rate of 0"""
        return all(
            0 < record.get("heartbeatLatency", 0) < 1000 and record["heartbeatPacketFailRate"] == 0
            for record in records
        )

    checks.within(RETURN_LIMIT, "heartbeat latency above 0, non-OK rate 0", lab.statuses, is_measured)


def check_tools(lab: Lab, checks: Checks):
    names = {
        "/bin/ping -V": "iputils",
        "/sbin/ifconfig --version": "net-tools",
        "/bin/ps --version": "procps-ng",
        "/bin/df --version": "GNU coreutils",
        "/bin/xz --version": "XZ Utils",
    }
    script = "; ".join(f"{command} 2>&1 | head -n 1" for command in names)
    lines = [line for output in lab.run(script) for line in output.splitlines()]
    expected = [*names.values()] * 2
    are_debians = len(lines) == len(expected) and all(map(str.__contains__, lines, expected))
    checks.that("ping, ifconfig, ps, df and xz are Debian's", are_debians, expected, lines)


def cut_link(lab: Lab, checks: Checks):
    checks.scene("The link goes down and comes up again")
    begin = time.monotonic()
    lab.set_link(False)
    checks.within(CUT_LIMIT, "both report dead and not connected after the cut", lab.statuses, [APART] * 2, begin)
    for node in lab.nodes:
        checks.equal(
            f"{node} has logged it",
            "Remote server status changed to dead",
            last_change(node),
        )
    begin = time.monotonic()
    lab.set_link(True)
    checks.within(
        RETURN_LIMIT, "both report alive and connected after the link is up", lab.statuses, [WELL] * 2, begin
    )


def kill_daemon(lab: Lab, checks: Checks):
    checks.scene("The daemon of node-b is killed and stays down")
    lab.b.run("systemctl kill --signal=KILL ternhad")
    begin = time.monotonic()
    checks.within(DEAD_LIMIT, "node-a reports dead", lab.a.status, DEAD | {"isDRBDConnect": True}, begin)
    checks.equal("systemd saw it killed", "code=killed, status=9/KILL", service.ends(lab.b)[-1])
    checks.equal("and does not restart it", "failed", service.state(lab.b))
    lab.b.run("systemctl start ternhad")
    checks.within(RETURN_LIMIT, "both report alive after its start", lab.statuses, [WELL] * 2)


def freeze_node(lab: Lab, checks: Checks):
    checks.scene("node-b is frozen: its emulator is stopped")
    begin = time.monotonic()
    lab.b.emulator.freeze()
    checks.within(DEAD_LIMIT, "node-a reports dead", lab.a.status, DEAD, begin)
    lab.b.emulator.thaw()
    checks.within(RETURN_LIMIT, "both report alive and connected when it continues", lab.statuses, [WELL] * 2)


def step_clock(lab: Lab, checks: Checks):
    checks.scene("The wall clock of node-b is stepped by an hour")

    def changes():
        return [len([line for line in node.log() if "Remote server status changed" in line]) for node in lab.nodes]

    before = changes()
    for direction, seconds in (("forward", "+ 3600"), ("back", "- 3600")):
        lab.b.run(f"date -s @$(($(date +%s) {seconds})) >/dev/null")
        checks.holds(LONGER_THAN_DEAD_AFTER, f"{direction}: both still report alive and connected", lab.statuses,
                     [WELL] * 2)
    checks.equal("neither has declared the other dead", before, changes())


def prepare_next_boot(node: Node):
    """Change settings of the daemon without the seconds that a restart takes."""
    # For hung_thread(): the optional source (-) is only there at one start.
    service.prepare_override(node, service.LASTING_DROP_IN, WATCHDOG, f"BindPaths=-{FIFO}:/proc/drbd")
    node.run(f"{RAISE_DEAD_AFTER} && sync")  # the reset flushes nothing


def raise_dead_after(lab: Lab, checks: Checks):
    checks.scene("dead-after is raised on node-a, as on node-b before its boot")
    lab.a.run(f"{RAISE_DEAD_AFTER} && systemctl restart ternhad")
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)


def upgrade_while_replicating(lab: Lab, checks: Checks):
    lab.a.run(START_WRITER)
    disconnects, received = count_disconnects(lab), drbd_received(lab.b)
    # The upgrade reloads systemd and restarts the daemon: with default intervals, for the measurement.
    lab.run(f"rm -f {service.LASTING_DROP_IN} && sed -i '/^[a-z-]*interval/d' {service.FILE}")
    upgrade(lab, checks, WELL, f"{MOUNT_PACKAGES} && dpkg --install /packages/new/*.deb")
    lab.a.run(STOP_WRITER)
    checks.that("DRBD has replicated all the while", drbd_received(lab.b) > received, f"more than {received} KiB",
                drbd_received(lab.b))
    checks.equal("and was never disconnected", disconnects, count_disconnects(lab))


def firewall(lab: Lab, checks: Checks):
    checks.scene("The firewall, which has been in place throughout")
    rules = lab.run("systemctl is-active --quiet ternha-firewall && nft list chain inet ternha input")
    accepted = [bool(re.search(r"packets [1-9]\d* bytes \d+ accept", text)) for text in rules]
    checks.equal("both accept the peer's datagrams", [True] * 2, accepted)
    checks.equal("neither has dropped one since its start", [1, 1], [text.count("packets 0 bytes 0 drop") for text in rules])
    ends = service.ends(lab.b)
    lab.a.run(f"ip address add {THIRD_HOST}/32 dev lo && {SEND_AS_THIRD_HOST % lab.b.address}")

    def dropped() -> bool:
        return "packets 1 bytes" in lab.b.run("nft list chain inet ternha input | grep drop")

    checks.within(RETURN_LIMIT, "it drops a third host's unknown request", dropped, True)
    checks.holds(SOME_ROUNDS, "which does not reach the daemon", lambda: service.ends(lab.b), ends)


def measure(lab: Lab, checks: Checks, begin: float, before: list[float]):
    """`before` is the processor time used at the time `begin`."""
    checks.scene("Resource use of ternhad")
    for node in lab.nodes:
        for process, resident, anonymous in memory(node):
            checks.fact(f"memory on {node}: {process} {resident} KiB resident, {anonymous} KiB of it anonymous")
    time.sleep(max(0, begin + IDLE - time.monotonic()))
    after = processor_use(lab)
    hour = 3600 / (time.monotonic() - begin)
    for node, use_before, use_after in zip(lab.nodes, before, after):
        use = (use_after - use_before) * hour
        checks.that(f"idle, emulated, default intervals, on {node}: {use:.0f} CPU seconds per hour",
                    use < IDLE_LIMIT, f"less than {IDLE_LIMIT} CPU seconds per hour", use)


def memory(node: Node) -> list[tuple[str, int, int]]:
    """Return name, resident and anonymous memory in KiB of each process of the service."""
    # The figures in `status` are only updated every 64 pages and thread.
    output = node.run(
        f"for process in $(cat {GROUP}/cgroup.procs); do"
        " echo $(cat /proc/$process/comm) $(sed -nE 's/^(Rss|Anonymous): +([0-9]+) kB/\\2/p' /proc/$process/smaps_rollup);"
        " done 2>/dev/null"
    )
    rows = [line.split() for line in output.splitlines()]
    return [(row[0], int(row[1]), int(row[2])) for row in rows if len(row) == 3]  # others have ended


def processor_use(lab: Lab) -> list[float]:
    """Return the processor time of the service on each node, in seconds."""
    outputs = lab.run(f"cat {GROUP}/cpu.stat")
    return [int(re.search(r"^usage_usec (\d+)$", output, re.MULTILINE).group(1)) / 1e6 for output in outputs]


def last_change(node: Node) -> str:
    changes = [line for line in node.log() if "Remote server status changed" in line]
    return changes[-1].split(" ", 2)[2] if changes else ""
