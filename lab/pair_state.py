"""What the scenes of the lab share: limits, states of a pair, DRBD as the kernel has it."""

import re

import service
from lab import Lab
from node import Node, parse_drbd_state

DEAD_LIMIT = 5  # seconds until a silent peer is declared dead
CUT_LIMIT = 8  # until both nodes declare the peer dead after a link cut
RESYNC_LIMIT = 3  # until both nodes report a resync
RETURN_LIMIT = 30  # until both nodes are in normal operation again
SOME_ROUNDS = 2  # seconds; the daemons check twice a second

ALIVE = {"isRemoteAlive": True}
DEAD = {"isRemoteAlive": False}
WELL = {"isRemoteAlive": True, "isDRBDConnect": True}
APART = {"isRemoteAlive": False, "isDRBDConnect": False}

MIRROR = "/dev/disk/by-id/virtio-md0 /dev/disk/by-id/virtio-md1"
START_WRITER = (
    "drbdadm primary r0 && systemd-run --quiet --unit=writer sh -c"
    " 'while dd if=/dev/urandom of=/dev/drbd0 bs=4k count=1 conv=fsync status=none; do sleep 1; done'"
)
STOP_WRITER = "systemctl stop writer && drbdadm secondary r0"
# For scenes in which a daemon is restarted: on an emulated processor that takes seconds.
RAISE_DEAD_AFTER = f"sed -i 's/^#dead-after = .*/dead-after = 15/' {service.FILE}"
STORAGE = f"drbdadm up r0 && mdadm --quiet --assemble /dev/md0 {MIRROR}"  # after a boot


def drbd_states(lab: Lab) -> list[str]:
    return [parse_drbd_state(output) for output in lab.run("cat /proc/drbd")]


def drbd_disks(lab: Lab) -> list[str]:
    """Return the local and the peer disk states of each node while Connected."""
    found = [re.search(r"cs:Connected .* ds:(\S+)", output) for output in lab.run("cat /proc/drbd")]
    return [match.group(1) if match else "" for match in found]


def drbd_received(node: Node) -> int:
    """Return how much the node has received from its peer, in KiB."""
    return int(re.search(r" nr:(\d+) ", node.run("cat /proc/drbd")).group(1))


def count_disconnects(lab: Lab) -> list[int]:
    """Return how often DRBD has left the state Connected on each node since its boot."""
    return [int(output) for output in lab.run("dmesg | grep -c 'conn( Connected -> ' || true")]
