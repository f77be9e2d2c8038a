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
BOOT_LIMIT = 60  # seconds
INTERRUPTIONS = (signal.SIGINT, signal.SIGTERM, signal.SIGHUP)


class Lab(NodePair):
    """Two emulated machines; leaves nothing behind."""

    def __init__(self, kernel: Path, archive: bytes, consoles: Consoles):
        """`archive` is the initramfs."""
        super().__init__()
        self._kernel = kernel
        self._archive = archive
        self._consoles = consoles
        self.directory = Path()
        self._emulators: list[Emulator] = []

    def set_link(self, up: bool):
        for node in self.nodes:
            node.emulator.set_link(up)

    def _start(self):
        self.directory = Path(tempfile.mkdtemp(prefix="ternha-lab."))
        system = self.directory / "system"
        system.write_bytes(self._archive)
        links = _link()
        for index, name in enumerate("ab"):
            channel = self.directory / f"node-{name}"
            emulator = Emulator(name, self._kernel, system, self._make_disks(name), links[index], channel)
            self._emulators.append(emulator)
            self._consoles.follow(name, emulator.console)
            self.nodes.append(Node(name, f"10.11.0.{index + 1}", emulator, Channel(f"node-{name}", channel)))
        for link in links:
            link.close()
        for node in self.nodes:
            node.wait_for_boot(BOOT_LIMIT)

    def _make_disks(self, name: str) -> dict[str, Path]:
        disks = {}
        for serial, size in DISKS.items():
            disks[serial] = self.directory / f"{name}.{serial}"
            with open(disks[serial], "wb") as file:
                os.truncate(file.fileno(), size)
        command = ["/sbin/mke2fs", "-q", "-F", "-t", "ext4", disks["log"]]
        result = subprocess.run(command, capture_output=True, text=True, check=False)
        if result.returncode != 0:
            raise LabError(f"mke2fs failed: {result.stderr}")
        return disks

    def _end(self):
        signal.pthread_sigmask(signal.SIG_BLOCK, INTERRUPTIONS)
        for emulator in self._emulators:
            emulator.end()
        for node in self.nodes:
            node.channel.close()
        if self.directory != Path():
            shutil.rmtree(self.directory)
        signal.pthread_sigmask(signal.SIG_UNBLOCK, INTERRUPTIONS)


def _link() -> list[socket.socket]:
    """Return both ends of a virtual cable: connected UDP sockets on loopback, on free ports."""
    ends = [socket.socket(socket.AF_INET, socket.SOCK_DGRAM) for _ in range(2)]
    for end in ends:
        end.bind(("127.0.0.1", 0))
    for end, other in zip(ends, reversed(ends)):
        end.connect(other.getsockname())
    return ends
