"""Two nodes and a third host on one machine, in namespaces joined by a bridge."""

import ctypes
import os
import re
import shutil
import signal
import subprocess
import time
from pathlib import Path

PROGRAMS = "/mnt"  # in each node
ADDRESSES = {"a": "10.77.0.1", "b": "10.77.0.2", "c": "10.77.0.3"}

libc = ctypes.CDLL(None)


def die_with_parent():
    libc.prctl(1, signal.SIGKILL)


def run(*argv):
    subprocess.run([str(argument) for argument in argv], check=True, stdout=subprocess.DEVNULL)


def eventually(limit, predicate, step=0.01):
    """Return whether `predicate` holds within `limit` seconds."""
    end = time.monotonic() + limit
    while not predicate():
        if time.monotonic() >= end:
            return False
        time.sleep(step)
    return True


class Node:
    """A node with its own network, hostname, /tmp, /run, /var and /dev/shm.

    With `build`, the directory of the programs, it can run ternhad.
    """

    def __init__(self, name, build=None):
        self.name = name
        self.address = ADDRESSES.get(name)
        self.processes = {}
        self.prefix = []  # of each command that is started, such as "env"
        setup = "echo ready; exec sleep infinity"
        if build:
            files = [build / "daemon/ternhad", build / "stepped_clock.so", *(build / "src").glob("libternhadaemon.so.?"),
                     *(build / "platform").glob("libterncore.so.?")]
            setup = f"""mount -t tmpfs -o size=64m none {PROGRAMS}
                cp -L {' '.join(map(str, files))} {PROGRAMS}
                for d in /tmp /run /var/log /var/lib /dev/shm; do mount -t tmpfs -o size=64m none $d; done
                mkdir -p /run/corosync /var/lib/corosync /var/log/corosync
                test ! -e /proc/sysrq-trigger || mount --bind /dev/null /proc/sysrq-trigger
                hostname node-{name}; echo node-{name} > /tmp/.ha.hostname.original
                ip link set lo up; {setup}"""
        self.holder = subprocess.Popen(
            ["unshare", "--net", "--mount", "--uts", "--ipc", "--propagation", "private", "sh", "-ec", setup],
            stdout=subprocess.PIPE, preexec_fn=die_with_parent)
        if self.holder.stdout.readline() != b"ready\n":
            raise RuntimeError(f"cannot make node {name}")

    def path(self, inside):
        return Path(f"/proc/{self.holder.pid}/root{inside}")

    def command(self, *argv):
        return ["nsenter", f"--target={self.holder.pid}", "--net", "--mount", "--uts", "--ipc",
                *[str(argument) for argument in argv]]

    def run(self, *argv):
        run(*self.command(*argv))

    def start(self, name, *argv, **options):
        """Start a process on the node, to be addressed as `name`."""
        process = subprocess.Popen(self.command(*self.prefix, *argv), stdout=subprocess.DEVNULL, stderr=subprocess.PIPE,
                                   preexec_fn=die_with_parent, start_new_session=True, **options)
        self.processes[name] = process
        return process

    def pid(self, name):
        return self.processes[name].pid

    def signal(self, number, names=None):
        for name in list(self.processes) if names is None else names:
            os.killpg(self.pid(name), number)

    def kill(self, names=None):
        for name in list(self.processes) if names is None else names:
            process = self.processes.pop(name)
            if process.poll() is None:
                os.killpg(process.pid, signal.SIGKILL)
            process.wait()
            process.stderr.close()

    def end(self):
        self.kill()
        self.holder.kill()
        self.holder.wait()
        self.holder.stdout.close()


class Cluster:
    """Nodes a and b, host c, and the bridge between them in its own namespace."""

    def __init__(self, build):
        self.switch = Node("switch")
        self.switch.run("ip", "link", "add", "bridge", "type", "bridge")
        self.switch.run("ip", "link", "set", "bridge", "up")
        self.a, self.b, self.c = (Node(name, build) for name in "abc")
        for node in (self.a, self.b, self.c):
            self.plug(node)

    def plug(self, node):
        port = f"port-{node.name}"
        run("ip", "link", "add", port, "netns", self.switch.holder.pid, "type", "veth", "peer", "name", "eth1",
            "netns", node.holder.pid)
        self.switch.run("ip", "link", "set", port, "master", "bridge", "up")
        node.run("ip", "address", "add", f"{node.address}/24", "dev", "eth1")
        node.run("ip", "link", "set", "eth1", "up")

    def unplug(self, node):
        self.switch.run("ip", "link", "delete", f"port-{node.name}")

    def set_link(self, node, is_up):
        self.switch.run("ip", "link", "set", f"port-{node.name}", "up" if is_up else "down")

    def end(self):
        for node in (self.a, self.b, self.c, self.switch):
            node.end()


class Daemon:
    """ternhad on a node.

    The state comes from its standard error, which needs neither descriptors nor disks.
    """

    def __init__(self, node, peer, options):
        self.node, self.peer, self.options = node, peer, options
        self.journal = ""

    def start(self):
        self._read()
        self.journal += "ternhad: started\n"
        process = self.node.start("ternhad", "env", f"LD_LIBRARY_PATH={PROGRAMS}", f"{PROGRAMS}/ternhad",
                                  "--local-ip", self.node.address, "--remote-ip", ADDRESSES[self.peer],
                                  "--interface", "eth1", *self.options)
        os.set_blocking(process.stderr.fileno(), False)

    def _read(self):
        if "ternhad" in self.node.processes:
            self.journal += (self.node.processes["ternhad"].stderr.read() or b"").decode()

    def sees_peer(self):
        """Return whether the peer is alive, or None while that is unknown."""
        self._read()
        states = re.findall(r"^ternhad: (started|peer-alive|peer-dead)\b", self.journal, re.MULTILINE)
        return {"peer-alive": True, "peer-dead": False}.get(states[-1]) if states else None

    def times_dead(self):
        """Return how often it has declared its peer dead."""
        self._read()
        return self.journal.count("ternhad: peer-dead")

    def end(self):
        self._read()
        if "ternhad" in self.node.processes:
            self.node.kill(["ternhad"])
        for directory in ("/var/log/ha", "/tmp/ha"):
            shutil.rmtree(self.node.path(directory), ignore_errors=True)


def require_root():
    if os.geteuid() != 0:
        raise SystemExit("pressure: needs root, for namespaces, limits and frozen file systems")
