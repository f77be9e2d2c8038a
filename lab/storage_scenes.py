"""Scenes of DRBD and md."""

import json
import re

from checks import Checks
from lab import Lab
from node import Node, parse_drbd_state, parse_status
from pair_state import (
    ALIVE, APART, CUT_LIMIT, DEAD_LIMIT, MIRROR, RESYNC_LIMIT, RETURN_LIMIT, SOME_ROUNDS, WELL, drbd_disks,
    drbd_states,
)

SLOW_RESYNC = "echo 500 >/proc/sys/dev/raid/speed_limit_min; echo 500 >/proc/sys/dev/raid/speed_limit_max"
FAST_RESYNC = "echo 200000 >/proc/sys/dev/raid/speed_limit_min; echo 200000 >/proc/sys/dev/raid/speed_limit_max"
SYNC_ACTION = "cat /sys/block/md0/md/sync_action"


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
    lab.run("drbdadm disk-options --resync-rate=50M r0")
    checks.within(RETURN_LIMIT, "the sync ends: DRBD is Connected, both disks up to date",
                  lambda: drbd_disks(lab), ["UpToDate/UpToDate"] * 2)
    checks.holds(SOME_ROUNDS, "both still report alive and connected", lab.statuses, [WELL] * 2)
    lab.run("drbdadm disk-options --resync-rate=1M r0")


def connected_during_state(lab: Lab) -> list[tuple[str, bool]]:
    """Return for each node the DRBD states around a query, and whether it reported connected."""
    looks = []
    for output in lab.run("grep cs: /proc/drbd; ternhactl status --json; grep cs: /proc/drbd"):
        before, record, after = output.splitlines()
        states = {parse_drbd_state(before), parse_drbd_state(after)}
        looks.append(("/".join(sorted(states)), parse_status(record)["isDRBDConnect"]))
    return looks


def md_actions(lab: Lab, checks: Checks):
    checks.scene("The md mirror of node-b: resync counts, check and recover do not")
    none = [{"isMDResync": False, "isRemoteMDResync": False}] * 2
    checks.within(RESYNC_LIMIT, "no resync yet", lab.statuses, none)
    lab.b.run(
        f"{SLOW_RESYNC}; mdadm --quiet --stop /dev/md0 &&"
        f" mdadm --quiet --assemble /dev/md0 --update=resync {MIRROR}"
        " && { mdadm --quiet --readwrite /dev/md0 || true; }"
    )
    checks.within(
        RESYNC_LIMIT,
        "resync: reported by the node and its peer",
        lab.statuses,
        [{"isMDResync": False, "isRemoteMDResync": True}, {"isMDResync": True, "isRemoteMDResync": False}],
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
        f"{SLOW_RESYNC}; disk=$(readlink -f /dev/disk/by-id/virtio-md1); mdadm --quiet /dev/md0 --fail $disk &&"
        " mdadm --quiet /dev/md0 --remove $disk && mdadm --quiet --zero-superblock $disk &&"
        " mdadm --quiet /dev/md0 --add $disk"
    )
    check_uncounted(lab, checks, "recover")
    lab.b.run(FAST_RESYNC)
    checks.within(RETURN_LIMIT, "md has finished the recovery", lambda: lab.b.run(SYNC_ACTION).strip(), "idle")


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
        r"^ *\d+ .*ternhad --config",
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
