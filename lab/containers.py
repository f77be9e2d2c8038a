"""Two containers with systemd over a bare Debian system, and the link between them."""

import os
import socket
import subprocess
import time
from pathlib import Path

from consoles import Consoles
from failure import LabError
from node import COMMAND_LIMIT, Node
from node_pair import NodePair

BOOT_LIMIT = 60  # seconds
END_LIMIT = 10
GROUPS = Path("/sys/fs/cgroup")
THIRD_HOST = "10.11.0.9"


class Shell:
    """Run scripts in a container."""

    def __init__(self, name: str, leader: int):
        self._name = name
        self._enter = [
            "nsenter", f"--target={leader}", "--mount", "--uts", "--ipc", "--net", "--pid", "--cgroup", "--root",
            "--wdns=/", "env", "--ignore-environment", "PATH=/usr/sbin:/usr/bin", "DEBIAN_FRONTEND=noninteractive",
            "bash", "-c",
        ]

    def start(self, script: str) -> subprocess.Popen:
        return subprocess.Popen(
            [*self._enter, script],
            stdin=subprocess.DEVNULL,
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            errors="replace",
        )

    def finish(self, started: subprocess.Popen, limit: float = COMMAND_LIMIT) -> tuple[int, str]:
        """Wait for a script; return its exit code and output, including standard error."""
        try:
            output, _ = started.communicate(timeout=limit)
        except subprocess.TimeoutExpired:
            started.kill()
            raise LabError(f"{self._name} did not reply in time") from None
        return started.returncode, output


class Containers(NodePair):
    """Two running containers, in network and mount namespaces of this process."""

    def __init__(self, root: str, packages: Path, consoles: Consoles):
        """`packages` becomes /packages in both."""
        super().__init__()
        self._root = root
        self._packages = packages
        self._consoles = consoles
        self._group = GROUPS / f"ternha-containers.{os.getpid()}"
        self._processes: list[subprocess.Popen] = []

    def _start(self):
        host("mount", "-t", "tmpfs", "tmpfs", "/run")
        host("mount", "-t", "cgroup2", "cgroup2", str(GROUPS))
        self._group.mkdir()
        host("ip", "link", "add", "cable", "type", "bridge")
        host("ip", "address", "add", f"{THIRD_HOST}/24", "dev", "cable")
        host("ip", "link", "set", "cable", "up")
        started = [self._start_node(name, f"10.11.0.{index + 1}") for index, name in enumerate("ab")]
        for name, address, leader in started:
            process_id = wait_until_ready(name, leader)
            self.nodes.append(Node(name, address, None, Shell(f"node-{name}", process_id)))
        for node in self.nodes:
            hide_trigger(node)

    def _start_node(self, name: str, address: str) -> tuple[str, str, socket.socket]:
        node = f"node-{name}"
        host("ip", "netns", "add", node)
        host("ip", "link", "add", "eth1", "netns", node, "type", "veth", "peer", "name", node)
        host("ip", "link", "set", node, "master", "cable", "up")
        host("ip", "-n", node, "address", "add", f"{address}/24", "dev", "eth1")
        host("ip", "-n", node, "link", "set", "eth1", "up")
        host("ip", "-n", node, "link", "set", "lo", "up")

        readiness = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        readiness.bind(f"/run/{node}.ready")
        group = self._group / node
        group.mkdir()
        ours, console = socket.socketpair()
        command = [
            "setpriv", "--pdeathsig=KILL", "sh", "-c", 'echo $$ >"$0/cgroup.procs" && exec "$@"', str(group),
            "systemd-nspawn", "--quiet", "--register=no", "--keep-unit", "--console=read-only",
            f"--directory={self._root}", "--volatile=overlay", f"--machine={node}", "--notify-ready=yes",
            f"--network-namespace-path=/run/netns/{node}", "--capability=CAP_NET_ADMIN",
            f"--bind-ro={self._packages}:/packages", "--setenv=TERM=dumb", "--boot",
            "systemd.journald.forward_to_console=1", "systemd.mask=console-getty.service",
        ]
        # Its own process group: Ctrl-C must reach only this process.
        self._processes.append(subprocess.Popen(
            command,
            stdin=subprocess.DEVNULL,
            stdout=console,
            stderr=console,
            env=os.environ | {"NOTIFY_SOCKET": f"/run/{node}.ready"},
            process_group=0,
        ))
        console.close()
        self._consoles.follow(name, ours)
        return name, address, readiness

    def _end(self):
        for process in self._processes:
            process.kill()
        groups = sorted([*self._group.glob("**/"), self._group], key=lambda path: -len(path.parts))
        if self._group.exists():
            (self._group / "cgroup.kill").write_text("1")
            deadline = time.monotonic() + END_LIMIT
            while "populated 1" in (self._group / "cgroup.events").read_text():
                if time.monotonic() > deadline:
                    raise LabError(f"processes are left in {self._group}")
                time.sleep(0.05)
            for group in dict.fromkeys(groups):
                group.rmdir()
        for process in self._processes:
            process.wait()


def host(*command: str):
    result = subprocess.run(command, capture_output=True, text=True, check=False)
    if result.returncode != 0:
        raise LabError(f"{' '.join(command)}: {result.stderr.strip()}")


def wait_until_ready(name: str, readiness: socket.socket) -> int:
    """Wait until the container has booted and return the pid of its init."""
    leader = 0
    deadline = time.monotonic() + BOOT_LIMIT
    while True:
        readiness.settimeout(max(deadline - time.monotonic(), 0.001))
        try:
            message = readiness.recv(4096).decode().splitlines()
        except TimeoutError:
            raise LabError(f"node-{name} did not come up in time") from None
        for line in message:
            if line.startswith("X_NSPAWN_LEADER_PID="):
                leader = int(line.partition("=")[2])
        if "READY=1" in message:
            return leader


def hide_trigger(node: Node):
    """Mount a plain file over the read-only trigger, which would reboot this machine."""
    node.run(
        "[ ! -e /proc/sysrq-trigger ] || { touch /run/no-trigger && mount --bind /run/no-trigger /proc/sysrq-trigger"
        " && grep -q 'tmpfs /proc/sysrq-trigger tmpfs' /proc/mounts; }"
    )
