"""Two emulated machines and the link between them."""

import os
import shutil
import signal
import socket
import subprocess
import tempfile
from pathlib import Path

from consoles import Consoles
from emulator import Emulator
from failure import LabError
from node import Channel, Node
from node_pair import NodePair

MIB = 1024 * 1024
DISKS = {"log": 16 * MIB, "drbd": 24 * MIB, "md0": 12 * MIB, "md1": 12 * MIB}  # by serial number
INTERRUPTIONS = (signal.SIGINT, signal.SIGTERM, signal.SIGHUP)


class Lab(NodePair):
    """Two emulated machines; leaves nothing behind."""

    def __init__(self, image: Path, packages: Path, consoles: Consoles):
        """Both boot the system in `image` and have a disk with the files of `packages`."""
        super().__init__()
        self._image = image
        self._packages = packages
        self._consoles = consoles
        self.directory = Path()
        self._links: list[socket.socket] = []
        self._emulators: list[Emulator] = []

    def set_link(self, up: bool):
        for node in self.nodes:
            node.emulator.set_link(up)

    def lose_power(self, node: Node):
        """Kill the machine and start it with the same disks."""
        node.emulator.end()
        node.channel.close()
        node.emulator, node.channel = self._power_on(self.nodes.index(node))

    def _start(self):
        self.directory = Path(tempfile.mkdtemp(prefix="ternha-lab."))
        run("mke2fs", "-q", "-t", "ext4", "-d", self._packages, self.directory / "packages", "16M")
        self._links = _link()
        for index, name in enumerate("ab"):
            self._make_disks(name)
            self.nodes.append(Node(name, f"10.11.0.{index + 1}", *self._power_on(index)))
        for node in self.nodes:
            node.wait_for_boot()

    def _power_on(self, index: int) -> tuple[Emulator, Channel]:
        name = "ab"[index]
        channel = self.directory / f"node-{name}"
        channel.unlink(missing_ok=True)
        disks = {serial: self.directory / f"{name}.{serial}" for serial in DISKS}
        disks |= {"packages": self.directory / "packages", "root": self.directory / f"{name}.qcow2"}
        emulator = Emulator(name, self._image, disks, self._links[index], channel)
        self._emulators.append(emulator)
        self._consoles.follow(name, emulator.console)
        return emulator, Channel(f"node-{name}", channel)

    def _make_disks(self, name: str):
        root = self._image / "root.img"
        run("qemu-img", "create", "-q", "-f", "qcow2", "-F", "raw", "-b", root, self.directory / f"{name}.qcow2")
        for serial, size in DISKS.items():
            with open(self.directory / f"{name}.{serial}", "wb") as file:
                os.truncate(file.fileno(), size)
        run("mke2fs", "-q", "-F", "-t", "ext4", self.directory / f"{name}.log")

    def _end(self):
        signal.pthread_sigmask(signal.SIG_BLOCK, INTERRUPTIONS)
        for emulator in self._emulators:
            emulator.end()
        for node in self.nodes:
            node.channel.close()
        for link in self._links:
            link.close()
        if self.directory != Path():
            shutil.rmtree(self.directory)
        signal.pthread_sigmask(signal.SIG_UNBLOCK, INTERRUPTIONS)


def run(*command: str | Path):
    environment = os.environ | {"PATH": os.environ["PATH"] + ":/usr/sbin:/sbin"}
    result = subprocess.run(command, capture_output=True, text=True, env=environment, check=False)
    if result.returncode != 0:
        raise LabError(f"{command[0]} failed: {result.stderr}")


def _link() -> list[socket.socket]:
    """Return both ends of a virtual cable: connected UDP sockets on loopback, on free ports."""
    ends = [socket.socket(socket.AF_INET, socket.SOCK_DGRAM) for _ in range(2)]
    for end in ends:
        end.bind(("127.0.0.1", 0))
    for end, other in zip(ends, reversed(ends)):
        end.connect(other.getsockname())
    return ends
