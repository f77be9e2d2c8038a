"""The scenes of the lab and their checks."""

import base64
import json
import lzma
import re
import time

from checks import Checks
from lab import Lab
from node import Node, parse_drbd_state, parse_status

DEAD_LIMIT = 5  # seconds until a silent peer is declared dead
CUT_LIMIT = 8  # until both nodes declare the peer dead after a link cut
RESYNC_LIMIT = 3  # until both nodes report a resync
RETURN_LIMIT = 20  # until both nodes are in normal operation again
SOME_ROUNDS = 2  # seconds; the daemons check twice a second
IDLE = 20  # seconds over which processor use is measured
TICKS = 100  # clock ticks of processor time in a second

ALIVE = {"isRemoteAlive": True}
DEAD = {"isRemoteAlive": False}
WELL = {"isRemoteAlive": True, "isDRBDConnect": True}
APART = {"isRemoteAlive": False, "isDRBDConnect": False}

SLOW_RESYNC = "echo 500 >/proc/sys/dev/raid/speed_limit_min; echo 500 >/proc/sys/dev/raid/speed_limit_max"
FAST_RESYNC = "echo 200000 >/proc/sys/dev/raid/speed_limit_min; echo 200000 >/proc/sys/dev/raid/speed_limit_max"
SYNC_ACTION = "cat /sys/block/md0/md/sync_action"


def run(lab: Lab, checks: Checks):
    for part in (
        find_each_other,
        initial_sync,
        cut_link,
        md_actions,
        split_brain,
        kill_daemon,
        freeze_node,
        step_clock,
        unknown_request,
        rotate_log,
        reboot_peer,
        measure,
    ):
        part(lab, checks)


def find_each_other(lab: Lab, checks: Checks):
    checks.scene("Two nodes start and detect each other")
    checks.equal("both run a 32-bit ARM kernel", ["armv7l\n"] * 2, lab.run("uname -m"))
    check_tools(lab, checks)
    lab.run(
        "drbdadm --force create-md r0 && drbdadm up r0 && mdadm --create /dev/md0 --run --assume-clean --quiet"
        " --level=1 --raid-devices=2 --metadata=1.2 /dev/disk/md0 /dev/disk/md1"
    )
    checks.within(RETURN_LIMIT, "DRBD is Connected on both", lambda: drbd_states(lab), ["Connected"] * 2)
    lab.run("rm /run/lab/hold")
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
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
    for output in lab.run(script):
        for name, line in zip(names.values(), output.splitlines(), strict=True):
            if name not in line:
                checks.equal("ping, ifconfig, ps, df and xz are Debian's", list(names.values()), output)
    checks.equal("ping, ifconfig, ps, df and xz are Debian's", True, True)


def initial_sync(lab: Lab, checks: Checks):
    checks.scene("First sync of DRBD")
    lab.a.run("drbdadm primary --force r0")
    checks.within(RESYNC_LIMIT, "DRBD is SyncSource on one, SyncTarget on the other", lambda: drbd_states(lab),
                  ["SyncSource", "SyncTarget"])
    checks.holds(
        SOME_ROUNDS,
        "the sync counts as connected",
        lambda: connected_during_state(lab),
        [("SyncSource", True), ("SyncTarget", True)],
    )
    lab.run("drbdadm disk-options --resync-rate=8M r0")
    checks.within(RETURN_LIMIT, "the sync ends: DRBD is Connected, both disks up to date",
                  lambda: drbd_disks(lab), ["UpToDate/UpToDate"] * 2)
    checks.holds(SOME_ROUNDS, "both still report alive and connected", lab.statuses, [WELL] * 2)
    lab.run("drbdadm disk-options --resync-rate=2M r0")


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


def md_actions(lab: Lab, checks: Checks):
    checks.scene("The md mirror of node-b: resync counts, check and recover do not")
    none = [{"isMDResync": False, "isRemoteMDResync": False}] * 2
    checks.within(RESYNC_LIMIT, "no resync yet", lab.statuses, none)
    lab.b.run(
        f"{SLOW_RESYNC}; mdadm --quiet --stop /dev/md0 &&"
        " mdadm --quiet --assemble /dev/md0 --update=resync /dev/disk/md0 /dev/disk/md1"
    )
    begin = resync_begin(lab.b)
    checks.within(
        RESYNC_LIMIT,
        "resync: reported by the node and its peer",
        lab.statuses,
        [{"isMDResync": False, "isRemoteMDResync": True}, {"isMDResync": True, "isRemoteMDResync": False}],
        begin,
    )
    checks.equal("md reports resync", "resync", lab.b.run(SYNC_ACTION).strip())
    check_snapshot(lab.a, checks, "isRemoteMDResync")
    check_snapshot(lab.b, checks, "isMDResync")
    lab.b.run(FAST_RESYNC)
    checks.within(RETURN_LIMIT, "md has finished the resync", lambda: lab.b.run(SYNC_ACTION).strip(), "idle")
    checks.within(DEAD_LIMIT, "cleared on both at the end", lab.statuses, none)

    lab.b.run(f"{SLOW_RESYNC}; echo check >/sys/block/md0/md/sync_action")
    check_uncounted(lab, checks, "check")
    lab.b.run(f"{FAST_RESYNC}; echo idle >/sys/block/md0/md/sync_action")
    lab.b.run(
        f"{SLOW_RESYNC}; disk=$(readlink -f /dev/disk/md1); mdadm --quiet /dev/md0 --fail $disk &&"
        " mdadm --quiet /dev/md0 --remove $disk && mdadm --quiet --zero-superblock $disk &&"
        " mdadm --quiet /dev/md0 --add $disk"
    )
    check_uncounted(lab, checks, "recover")
    lab.b.run(FAST_RESYNC)
    checks.within(RETURN_LIMIT, "md has finished the recovery", lambda: lab.b.run(SYNC_ACTION).strip(), "idle")


def resync_begin(node: Node) -> float:
    """Return when md began its latest resync, on this machine's clock."""
    message, uptime = node.run(
        "dmesg | grep 'md: resync of RAID array md0' | tail -n 1; cat /proc/uptime"
    ).splitlines()
    age = float(uptime.split()[0]) - float(message.strip("[").split("]")[0])
    return time.monotonic() - age


def check_uncounted(lab: Lab, checks: Checks, action: str):
    checks.within(RESYNC_LIMIT, f"md reports {action}", lambda: lab.b.run(SYNC_ACTION).strip(), action)

    def look():
        started = lab.a.channel.start("ternhactl status --json")
        before, record, after = lab.b.run(f"{SYNC_ACTION}; ternhactl status --json; {SYNC_ACTION}").splitlines()
        peer_record = json.loads(lab.a.result("status", started))
        return before, json.loads(record)["isMDResync"], after, peer_record["isRemoteMDResync"]

    checks.holds(SOME_ROUNDS, f"{action} does not count", look, (action, False, action, False))


def check_snapshot(node: Node, checks: Checks, flag: str):
    """Check for a snapshot whose status record has the flag set."""
    parts = [
        rf'^\{{.*"{flag}":true.*\}}$',
        r"^ *\d+ .* ternhad --config",
        r"^/dev/vd.* \d+% /var/log/ha$",
        r"^MemTotal: +\d+ kB$",
    ]

    def is_complete(record):
        """status record with the flag, ternhad, /var/log/ha among file systems, memory figures"""
        position = 0
        for part in parts:
            found = re.compile(part, re.MULTILINE).search(record, position)
            if not found:
                return False
            position = found.end()
        return True

    checks.within(
        DEAD_LIMIT,
        f"{node} has recorded {flag}, processes, file systems and memory",
        lambda: node.run("cat /var/log/ha/ha.daemon.record /tmp/ha/ha.daemon.record 2>/dev/null || true"),
        is_complete,
    )


def split_brain(lab: Lab, checks: Checks):
    checks.scene("Split brain: both nodes write while the link is cut")
    lab.set_link(False)
    checks.within(CUT_LIMIT, "both report dead and not connected", lab.statuses, [APART] * 2)
    lab.b.run("drbdadm primary r0")
    lab.run("dd if=/dev/urandom of=/dev/drbd0 bs=4096 count=4 conv=fsync 2>/dev/null && drbdadm secondary r0")
    lab.set_link(True)

    def is_refused(states):
        """StandAlone on one or both nodes, and neither is connected"""
        return "StandAlone" in states and set(states) <= {"StandAlone", "WFConnection"}

    checks.within(RETURN_LIMIT, "DRBD refuses to connect: StandAlone", lambda: drbd_states(lab), is_refused)
    checks.within(
        RETURN_LIMIT, "both report alive, but not connected", lab.statuses, [ALIVE | {"isDRBDConnect": False}] * 2
    )
    checks.holds(
        SOME_ROUNDS,
        "and it stays so",
        lab.statuses,
        [ALIVE | {"isDRBDConnect": False}] * 2,
    )
    checks.that("DRBD is still StandAlone", is_refused(drbd_states(lab)), is_refused.__doc__, drbd_states(lab))
    lab.b.run("drbdadm disconnect r0; drbdadm connect --discard-my-data r0")
    lab.a.run("drbdadm disconnect r0; drbdadm connect r0")
    checks.within(RETURN_LIMIT, "resolved: both report connected again", lab.statuses, [WELL] * 2)
    checks.within(RETURN_LIMIT, "and both disks are up to date", lambda: drbd_disks(lab), ["UpToDate/UpToDate"] * 2)


def kill_daemon(lab: Lab, checks: Checks):
    checks.scene("The daemon of node-b is killed")
    lab.b.hold_daemon()
    begin = time.monotonic()
    lab.b.run("kill -KILL $(cat /run/lab/pid)")
    checks.within(DEAD_LIMIT, "node-a reports dead", lab.a.status, DEAD | {"isDRBDConnect": True}, begin)
    checks.equal("the supervisor saw it killed", "137", lab.b.supervised()[-1][-1])
    lab.b.release_daemon()
    checks.within(RETURN_LIMIT, "both report alive after its restart", lab.statuses, [WELL] * 2)


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
        checks.holds(
            DEAD_LIMIT, f"{direction}: both still report alive and connected", lab.statuses, [WELL] * 2
        )
    checks.equal("neither has declared the other dead", before, changes())


def unknown_request(lab: Lab, checks: Checks):
    checks.scene("node-a sends node-b an unknown request")
    pid = lab.b.run("cat /run/lab/pid").strip()
    lab.a.run(f"ternha-lab-tool send {lab.b.address} no_such_request")
    checks.within(
        DEAD_LIMIT,
        "SIGABRT ended the daemon and the supervisor restarted it",
        lambda: without_pids(lab.b.supervised()[-2:]),
        [["end", "134"], ["start"]],
    )
    ended, started = lab.b.supervised()[-2:]
    is_other = ended[1] == pid != started[1]
    checks.that("the process is another one", is_other, f"the end of {pid}", [ended, started])
    checks.within(RETURN_LIMIT, "both report alive", lab.statuses, [WELL] * 2)


def rotate_log(lab: Lab, checks: Checks):
    checks.scene("node-a moves and rotates a log of 200 lines")
    node = lab.a
    checks.equal("there is no archive yet", "", node.run("ls /var/log/ha | grep xz || true"))
    node.run("ternha-lab-tool log 1 200")
    expected = [f"lab line {number}" for number in range(1, 201)]
    before = node.log()
    checks.equal("the lines are in the log", expected, lab_lines(before))
    archive = "/var/log/ha/ha.daemon.log.0.xz"
    node.run("kill -HUP $(cat /run/lab/pid)")
    checks.within(
        RETURN_LIMIT,
        "there is one archive of the log, and no log",
        lambda: node.run("cd /var/log/ha && ls ha.daemon.log*").split(),
        ["ha.daemon.log.0.xz"],
    )
    unpacked = node.run(f"/bin/xz --decompress --stdout {archive}")
    packed = base64.b64decode(node.run(f"base64 {archive}"))
    checks.equal(
        "it is in xz format: another implementation unpacks the same text",
        unpacked,
        lzma.decompress(packed, lzma.FORMAT_XZ).decode(),
    )
    checks.equal("it unpacks to the 200 lines", expected, lab_lines(unpacked.splitlines()))
    checks.equal("and all earlier lines", before, unpacked.splitlines()[: len(before)])


def reboot_peer(lab: Lab, checks: Checks):
    checks.scene("node-a requests a reboot of node-b")
    lab.b.run("ternha-lab-tool log 201 250")
    on_disk = "cat /var/log/ha/ha.daemon.log 2>/dev/null || true"
    expected = [f"lab line {number}" for number in range(201, 251)]
    checks.equal("50 lines are not on the disk of node-b yet", [], lab_lines(lab.b.run(on_disk).splitlines()))
    resets = len(lab.b.emulator.events("RESET"))
    boot_id = lab.b.boot_id
    before = lab.b.log()
    checks.equal("but in its log", expected, lab_lines(before))

    # All three at once: the node boots quickly.
    order, rebooting, record = lab.a.run(
        "ternhactl reboot-peer --yes | tail -n 1; ternhactl rebooting || true; ternhactl status --json", 45
    ).splitlines()
    checks.equal("the request succeeds", "The peer went down, or the link to it. It counts as rebooting until it replies again.", order)
    checks.equal("node-a reports rebooting", "yes", rebooting)
    checks.equal("and dead", False, parse_status(record)["isRemoteAlive"])
    checks.that("node-a has logged it", lab.a.has_logged(" Remote offline"), "Remote offline", lab.a.log()[-5:])

    lab.b.wait_for_boot()
    new_resets = lab.b.emulator.events("RESET")[resets:]
    checks.equal(
        "the emulator saw the guest reset itself, once",
        [{"guest": True, "reason": "guest-reset"}],
        [event["data"] for event in new_resets],
    )
    checks.that("node-b has another boot id", lab.b.boot_id != boot_id, f"other than {boot_id}", lab.b.boot_id)
    after = lab.b.run(on_disk).splitlines()
    checks.equal("the 50 lines are on its disk", expected, lab_lines(after))
    checks.equal("and every earlier line", before, after[: len(before)])

    lab.b.run("mdadm --quiet --assemble /dev/md0 /dev/disk/md0 /dev/disk/md1 && drbdadm up r0")
    lab.b.release_daemon()
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
    checks.equal("node-a no longer reports rebooting", (1, "no\n"), lab.a.try_run("ternhactl rebooting"))


def measure(lab: Lab, checks: Checks):
    checks.scene("Resource use of ternhad")
    for node in lab.nodes:
        resident, anonymous = memory(node)
        checks.fact(f"memory on {node}: {resident} KiB resident, {anonymous} KiB of it anonymous")
    lab.run("sed -i /interval/d /etc/ternha/ternhad.conf && kill -TERM $(cat /run/lab/pid)")
    checks.within(
        RETURN_LIMIT,
        "both stopped cleanly and were restarted with the default intervals",
        lambda: [without_pids(node.supervised()[-2:]) for node in lab.nodes],
        [[["end", "0"], ["start"]]] * 2,
    )
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
    before = processor_use(lab)
    begin = time.monotonic()
    time.sleep(IDLE)
    after = processor_use(lab)
    hour = 3600 / (time.monotonic() - begin)
    for node, (own, children), (own_before, children_before) in zip(lab.nodes, after, before):
        checks.fact(
            f"idle, emulated, on {node}: {(own - own_before) * hour:.0f} CPU seconds per hour,"
            f" and {(children - children_before) * hour:.0f} in the programs that it runs"
        )


def without_pids(entries: list[list[str]]) -> list[list[str]]:
    return [entry[:1] + entry[2:] for entry in entries]


def memory(node: Node) -> tuple[int, int]:
    """Return the resident and the anonymous memory of the daemon in KiB."""
    fields = dict(
        line.split(":", 1) for line in node.run("cat /proc/$(cat /run/lab/pid)/status").splitlines()
    )
    return int(fields["VmRSS"].split()[0]), int(fields["RssAnon"].split()[0])


def processor_use(lab: Lab) -> list[tuple[float, float]]:
    """Return the processor time of the daemon and its children on each node, in seconds."""
    outputs = lab.run("cat /proc/$(cat /run/lab/pid)/stat")
    times = [list(map(int, output.rpartition(")")[2].split()[11:15])) for output in outputs]
    return [((user + system) / TICKS, (c_user + c_system) / TICKS) for user, system, c_user, c_system in times]


def drbd_states(lab: Lab) -> list[str]:
    return [parse_drbd_state(output) for output in lab.run("cat /proc/drbd")]


def drbd_disks(lab: Lab) -> list[str]:
    """Return the local and the peer disk states of each node while Connected."""
    found = [re.search(r"cs:Connected .* ds:(\S+)", output) for output in lab.run("cat /proc/drbd")]
    return [match.group(1) if match else "" for match in found]


def connected_during_state(lab: Lab) -> list[tuple[str, bool]]:
    """Return for each node the DRBD states around a query, and whether it reported connected."""
    looks = []
    for output in lab.run("grep cs: /proc/drbd; ternhactl status --json; grep cs: /proc/drbd"):
        before, record, after = output.splitlines()
        states = {parse_drbd_state(before), parse_drbd_state(after)}
        looks.append(("/".join(sorted(states)), parse_status(record)["isDRBDConnect"]))
    return looks


def last_change(node: Node) -> str:
    changes = [line for line in node.log() if "Remote server status changed" in line]
    return changes[-1].split(" ", 2)[2] if changes else ""


def lab_lines(lines: list[str]) -> list[str]:
    """Return the lines logged by the lab tool, without time stamps."""
    return [line.split(" ", 1)[1] for line in lines if " lab line " in line]
