"""Scenes of the logs: rotation, a full disk, and what survives the end of a machine."""

import base64
import lzma
import time
from dataclasses import dataclass

import service
from checks import Checks
from lab import Lab
from node import Node, parse_status
from pair_state import (
    DEAD, DEAD_LIMIT, RETURN_LIMIT, SOME_ROUNDS, START_WRITER, STOP_WRITER, STORAGE, WELL, drbd_disks,
)

ON_DISK = (
    "cd /var/log/ha; for file in $(ls -rv ha.daemon.log.*.xz 2>/dev/null); do xz -dc $file; done;"
    " cat ha.daemon.log 2>/dev/null || true"
)
# Until not even a block can be added: a large write leaves blocks that a small one can use, and so
# does an archive that is still being written, which fails then.
FILL = (
    "while pgrep -x xz >/dev/null; do sleep 0.1; done; cd /var/log/ha; add() { dd if=/dev/zero of=filler oflag=append conv=notrunc,fsync \"$@\" 2>/dev/null; };"
    " add bs=64k; add bs=1k; ! add bs=1k count=1"
)
NEWEST_ON_DISK = "cat /var/log/ha/ha.daemon.log 2>/dev/null || true"
READS_STANDARD_INPUT = ["3", "0x0"]  # system call and argument, on 32-bit ARM


def rotate_log(lab: Lab, checks: Checks):
    checks.scene("node-a moves and rotates a log of 200 lines")
    node = lab.a
    checks.equal("there is no archive yet", "", node.run("ls /var/log/ha | grep xz || true"))
    log_lines(node, 1, 200)
    expected = expected_lines(1, 200)
    before = node.log()
    checks.equal("the lines are in the log", expected, lab_lines(before))
    archive = "/var/log/ha/ha.daemon.log.0.xz"
    node.run("systemctl reload ternhad")
    checks.within(
        RETURN_LIMIT,
        "there is one archive of the log, and no log",
        lambda: node.run("ls /var/log/ha | grep '^ha.daemon.log' || true").split(),
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


@dataclass
class Before:
    """node-b before its machine went down."""

    boot_id: str
    resets: int  # of the guest by itself, since the emulator was started
    log: list[str]


def fill_disk(lab: Lab, checks: Checks) -> tuple[int, list[str]]:
    """Return the daemon's pid and the lines that are on the disk."""
    checks.scene("/var/log/ha of node-a is full")
    node = lab.a
    before = service.pid(node), lab_lines(on_disk(node))
    node.run(FILL)
    log_lines(node, 201, 250)
    node.run("systemctl reload ternhad")
    checks.within(RETURN_LIMIT, "the buffer is emptied nevertheless",
                  lambda: lab_lines(node.run("cat /tmp/ha/ha.daemon.log").splitlines()), [])
    return before


def free_disk(lab: Lab, checks: Checks, before: tuple[int, list[str]]):
    checks.scene("/var/log/ha of node-a has space again")
    node = lab.a
    checks.equal("until now it had the earlier lines and no space for another, by the same daemon", before,
                 (service.pid(node), lab_lines(on_disk(node))))
    node.run("rm /var/log/ha/filler")
    log_lines(node, 251, 300)
    node.run("systemctl reload ternhad")
    checks.within(RETURN_LIMIT, "new lines get there", lambda: lab_lines(on_disk(node))[-50:], expected_lines(251, 300))


def lose_power(lab: Lab, checks: Checks) -> Before:
    checks.scene("node-b loses power: its emulator is killed and started again")
    node = lab.b
    log_lines(node, 301, 350)
    node.run("systemctl reload ternhad")
    checks.within(RETURN_LIMIT, "50 lines are moved to the disk", lambda: lab_lines(on_disk(node))[-50:],
                  expected_lines(301, 350))
    checks.within(RETURN_LIMIT, "the log keeper waits for its next request",
                  lambda: node.run("cat /proc/$(pgrep -x ternhad-logs)/syscall 2>/dev/null || true").split()[:2], READS_STANDARD_INPUT)
    before = Before(boot_id=node.boot_id, resets=0, log=on_disk(node))  # no resets of the next emulator
    lab.a.run(START_WRITER)
    begin = time.monotonic()
    lab.lose_power(node)
    checks.within(DEAD_LIMIT, "node-a reports dead", lab.a.status, DEAD, begin)
    return before


def return_after_power_loss(lab: Lab, checks: Checks, before: Before):
    checks.scene("node-b, which lost power, is back")
    node = lab.b
    wait_for_boot(lab, checks, before)
    checks.equal("its log holds every line that was moved", before.log, on_disk(node)[: len(before.log)])
    node.run(STORAGE)
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
    lab.a.run(STOP_WRITER)
    checks.within(RETURN_LIMIT, "DRBD has resynced", lambda: node.try_run("dmesg | grep -q 'Resync done'")[0], 0)
    checks.within(RETURN_LIMIT, "and both disks are up to date", lambda: drbd_disks(lab), ["UpToDate/UpToDate"] * 2)
    checks.holds(SOME_ROUNDS, "both still report alive and connected", lab.statuses, [WELL] * 2)


def reboot_peer(lab: Lab, checks: Checks) -> Before:
    checks.scene("node-a requests a reboot of node-b")
    log_lines(lab.b, 351, 400)
    checks.equal("50 lines are not on the disk of node-b yet", [], lab_lines(lab.b.run(NEWEST_ON_DISK).splitlines()))
    before = Before(boot_id=lab.b.boot_id, resets=len(lab.b.emulator.events("RESET")), log=lab.b.log())
    checks.equal("but in its log", expected_lines(351, 400), lab_lines(before.log))

    # All three at once, before the node is back.
    order, rebooting, record = lab.a.run(
        "ternhactl reboot-peer --yes | tail -n 1; ternhactl rebooting || true; ternhactl status --json",
    ).splitlines()
    checks.equal("the request succeeds", "The peer went down, or the link to it. It counts as rebooting until it replies again.", order)
    checks.equal("node-a reports rebooting", "yes", rebooting)
    checks.equal("and dead", False, parse_status(record)["isRemoteAlive"])
    checks.that("node-a has logged it", lab.a.has_logged(" Remote offline"), "Remote offline", lab.a.log()[-5:])
    return before


def return_after_reboot(lab: Lab, checks: Checks, before: Before):
    checks.scene("node-b, which was rebooted, is back")
    wait_for_boot(lab, checks, before)
    checks.equal(
        "the emulator saw the guest reset itself, once",
        [{"guest": True, "reason": "guest-reset"}],
        [event["data"] for event in lab.b.emulator.events("RESET")[before.resets :]],
    )
    after = lab.b.run(NEWEST_ON_DISK).splitlines()
    checks.equal("the 50 lines are on its disk", expected_lines(351, 400), lab_lines(after))
    checks.equal("and every earlier line", before.log, after[: len(before.log)])

    lab.b.run(STORAGE)
    checks.within(RETURN_LIMIT, "both report alive and connected", lab.statuses, [WELL] * 2)
    checks.equal("node-a no longer reports rebooting", (1, "no\n"), lab.a.try_run("ternhactl rebooting"))


def wait_for_boot(lab: Lab, checks: Checks, before: Before):
    lab.b.wait_for_boot()
    boot_id = lab.b.boot_id
    checks.that("it has another boot id", boot_id != before.boot_id, f"other than {before.boot_id}", boot_id)


def lab_lines(lines: list[str]) -> list[str]:
    """Return the lines logged by the lab tool, without time stamps."""
    return [line.split(" ", 1)[1] for line in lines if " lab line " in line]


def log_lines(node: Node, first: int, last: int):
    node.run(f"ternha-lab-tool {first} {last}")


def expected_lines(first: int, last: int) -> list[str]:
    return [f"lab line {number}" for number in range(first, last + 1)]


def on_disk(node: Node) -> list[str]:
    """Return the lines on the disk, those of the archives first."""
    return node.run(ON_DISK).splitlines()
