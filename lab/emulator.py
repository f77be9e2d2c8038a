"""One emulated machine."""

import json
import socket
import subprocess
import time
from pathlib import Path

from failure import LabError

PROMPT = 10  # seconds within which an emulator replies
KERNEL_OPTIONS = (
    "console=ttyAMA0 quiet panic=5 cryptomgr.notests net.ifnames=0 root=/dev/vda rw rootflags=noatime"
    " systemd.show_status=0 systemd.journald.forward_to_console=1"
)


class Emulator:
    """A running emulator, controlled by the QEMU Machine Protocol; dies with this process."""

    def __init__(
        self,
        name: str,
        image: Path,
        disks: dict[str, Path],
        link: socket.socket,
        channel: Path,
    ):
        """Start the machine called `name`.

        image: directory with kernel and initramfs.
        disks: by serial number; the last one has the root.
        link: datagram socket to which the network interface is connected.
        channel: path of the Unix socket on which its command channel will listen.
        """
        self.name = name
        self.console, console = socket.socketpair()
        self._control, control = socket.socketpair()
        self._control.settimeout(PROMPT)
        self._events: list[dict] = []
        self._input = b""
        passed = [console, control, link]
        command = [
            "setpriv", "--pdeathsig", "KILL",
            "qemu-system-arm", "-no-user-config", "-nodefaults", "-display", "none",
            "-machine", "virt,highmem=off", "-cpu", "cortex-a15", "-smp", "1", "-m", "256",
            "-accel", "tcg,thread=single,tb-size=256",
            "-kernel", image / "vmlinuz", "-initrd", image / "initrd",
            "-append", f"{KERNEL_OPTIONS} systemd.hostname=node-{name}",
            "-chardev", f"socket,id=console,fd={console.fileno()}", "-serial", "chardev:console",
            "-chardev", f"socket,id=control,fd={control.fileno()}", "-mon", "chardev=control,mode=control",
            "-chardev", f"socket,id=channel,path={channel},server=on,wait=off",
            "-device", "virtio-serial-device", "-device", "virtserialport,chardev=channel,name=channel",
            "-device", "virtio-rng-device",
            "-netdev", f"dgram,id=link,local.type=fd,local.str={link.fileno()}",
            "-device", f"virtio-net-device,netdev=link,mac=52:54:00:00:00:{ord(name) - ord('a') + 1:02x}",
        ]
        for serial, disk in disks.items():
            kind = "qcow2" if disk.suffix == ".qcow2" else "raw"
            access = ",readonly=on" if serial == "packages" else ""  # shared by both machines
            command += ["-drive", f"if=none,id={serial},file={disk},format={kind},cache=unsafe{access}"]
            command += ["-device", f"virtio-blk-device,drive={serial},serial={serial}"]
        # Its own process group: Ctrl-C must reach only this process, which stops the emulator.
        self._process = subprocess.Popen(
            command,
            stdin=subprocess.DEVNULL,
            stdout=subprocess.DEVNULL,
            stderr=subprocess.PIPE,
            pass_fds=[end.fileno() for end in passed],
            process_group=0,
        )
        console.close()
        control.close()
        self._receive()  # the greeting
        self.execute("qmp_capabilities")

    @property
    def pid(self) -> int:
        return self._process.pid

    def execute(self, command: str, **arguments):
        """Run a command of the protocol and return its result."""
        request = {"execute": command, "arguments": arguments}
        self._control.sendall(json.dumps(request).encode() + b"\n")
        while True:
            message = self._receive()
            if "error" in message:
                raise LabError(f"emulator {self.name}: {command}: {message['error']['desc']}")
            if "return" in message:
                return message["return"]
            self._events.append(message)

    def events(self, name: str) -> list[dict]:
        """Return the events of this name so far, each with its data and time."""
        self.execute("query-status")  # events before the reply have been read
        return [event for event in self._events if event["event"] == name]

    def set_link(self, up: bool):
        """Set the carrier of the network interface."""
        self.execute("set_link", name="link", up=up)

    def freeze(self):
        self.execute("stop")

    def thaw(self):
        self.execute("cont")

    def end(self):
        self._process.kill()
        self._process.wait()
        self._process.stderr.close()
        self._control.close()

    def _receive(self) -> dict:
        deadline = time.monotonic() + PROMPT
        while b"\n" not in self._input:
            try:
                data = self._control.recv(65536)
            except TimeoutError:
                data = None
            except ConnectionResetError:
                data = b""
            if data == b"":
                raise LabError(f"emulator {self.name} has ended: {self._last_words()}")
            if data is None or time.monotonic() > deadline:
                raise LabError(f"emulator {self.name} does not reply")
            self._input += data
        line, _, self._input = self._input.partition(b"\n")
        return json.loads(line)

    def _last_words(self) -> str:
        self._process.kill()
        self._process.wait()
        return self._process.stderr.read().decode(errors="replace").strip() or "without a word"
