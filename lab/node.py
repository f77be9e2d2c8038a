"""A node: runs commands and reads its state."""

import base64
import json
import socket
import time
from collections import deque
from pathlib import Path

from failure import LabError

BOOT_LIMIT = 300  # seconds, on a busy host
COMMAND_LIMIT = 300  # unless a command says otherwise


class Channel:
    """Run scripts on a machine through its command channel, which survives a reboot."""

    def __init__(self, name: str, path: Path):
        self._name = name
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        try:
            self._socket.connect(str(path))
        except OSError as error:
            raise LabError(f"{path}: {error.strerror}") from None
        self._input = b""
        self._last_id = 0
        self._boot_ids: deque[str] = deque()

    def wait_for_boot(self, limit: float) -> str:
        """Wait for the next boot and return its id."""
        deadline = time.monotonic() + limit
        while not self._boot_ids:
            self._take_line(deadline, "come up")
        return self._boot_ids.popleft()

    def start(self, script: str) -> int:
        self._last_id = time.monotonic_ns()  # unique on this channel
        escaped = script.replace("\\", "\\\\").replace("\n", "\\n")
        line = f"{self._last_id} {escaped}\n"
        self._socket.settimeout(COMMAND_LIMIT)
        try:
            self._socket.sendall(line.encode())
        except OSError as error:
            raise LabError(f"{self._name} accepts no command: {error}") from None
        return self._last_id

    def finish(self, script_id: int, limit: float = COMMAND_LIMIT) -> tuple[int, str]:
        """Wait for a script; return its exit code and output, including standard error."""
        deadline = time.monotonic() + limit
        while True:
            fields = self._take_line(deadline, "reply").split(" ")
            if fields[0] == str(script_id) and len(fields) == 3:
                return int(fields[1]), base64.b64decode(fields[2]).decode(errors="replace")

    def close(self):
        self._socket.close()

    def _take_line(self, deadline: float, what: str) -> str:
        while b"\n" not in self._input:
            self._socket.settimeout(max(deadline - time.monotonic(), 0.001))
            try:
                data = self._socket.recv(65536)
            except TimeoutError:
                raise LabError(f"{self._name} did not {what} in time") from None
            except OSError:
                data = b""
            if not data:
                raise LabError(f"the emulator of {self._name} has ended")
            self._input += data
        line, _, self._input = self._input.partition(b"\n")
        text = line.decode(errors="replace")
        if text.startswith("hello "):
            self._boot_ids.append(text.split()[1])
        return text


class Node:
    """One of the two nodes."""

    def __init__(self, name: str, address: str, emulator, channel: Channel):
        self.name = f"node-{name}"
        self.address = address
        self.emulator = emulator
        self.channel = channel
        self.boot_id = ""

    def __str__(self):
        return self.name

    def wait_for_boot(self, limit: float = BOOT_LIMIT):
        self.boot_id = self.channel.wait_for_boot(limit)

    def run(self, script: str, limit: float = COMMAND_LIMIT) -> str:
        """Run the script, which must succeed, and return its output."""
        return self.result(script, self.channel.start(script), limit)

    def result(self, script: str, script_id: int, limit: float = COMMAND_LIMIT) -> str:
        code, output = self.channel.finish(script_id, limit)
        if code != 0:
            raise LabError(f"{self}: exit code {code} of: {script}\n{output}")
        return output

    def try_run(self, script: str) -> tuple[int, str]:
        """Run the script; return its exit code and output."""
        return self.channel.finish(self.channel.start(script))

    def status(self) -> dict:
        """Return the status record from ternhactl."""
        return parse_status(self.run(STATUS))

    def log(self) -> list[str]:
        """Return the daemon log: lines on disk, then buffered lines."""
        return self.run(READ_LOG % "").splitlines()

    def full_log(self) -> list[str]:
        """Return the daemon log with its archives."""
        return self.run(FULL_LOG).splitlines()

    def has_logged(self, text: str) -> bool:
        return any(line.endswith(text) for line in self.log())

    def drbd_state(self) -> str:
        """Return the connection state of the resource, such as Connected; empty if it is down."""
        return parse_drbd_state(self.run("cat /proc/drbd"))


# Repeats if the daemon moved lines meanwhile: the read could miss them.
READ_LOG = (
    "cd /var/log/ha || exit 0; state() { stat --format=%%i-%%s ha.daemon.log 2>/dev/null; };"
    " while before=$(state); text=$(%s cat ha.daemon.log /tmp/ha/ha.daemon.log 2>/dev/null);"
    ' [ "$before" != "$(state)" ]; do :; done; printf "%%s\\n" "$text"'
)
FULL_LOG = READ_LOG % "for file in $(ls -rv ha.daemon.log.*.xz 2>/dev/null); do xz -dc $file; done;"
# A daemon that is starting or was killed has no status.
STATUS = "ternhactl status --json 2>/dev/null || echo null"


def parse_status(text: str) -> dict:
    return json.loads(text) or {}


def parse_drbd_state(text: str) -> str:
    for word in text.split():
        if word.startswith("cs:"):
            return word[3:]
    return ""
