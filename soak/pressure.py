"""Put node a under pressure; count false positives and measure the detection of a real failure."""

import argparse
import os
import resource
import signal
import subprocess
import sys
import time
from contextlib import closing, suppress
from pathlib import Path

from detection import Watchers, killed, measure, table_head, table_row
from nodes import PROGRAMS, Cluster, eventually, require_root

BUSY = "while :; do :; done"
FLOOD = """import socket, sys
s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
while True:
    try:
        s.sendto(b"is_alive", (sys.argv[1], 7499))
    except OSError:
        pass"""
FORKS = """import os, signal, sys, time
sys.stdin.readline()
signal.signal(signal.SIGCHLD, signal.SIG_IGN)
while True:
    try:
        if os.fork() == 0:
            time.sleep(0.5)
            os._exit(0)
    except OSError:
        time.sleep(0.001)"""
THRASH = """import sys
sys.stdin.readline()
with open("/tmp/thrash", "wb") as f: f.write(bytes(60 << 20))
blocks = []
while True:
    with open("/tmp/thrash", "rb") as f:
        while f.read(1 << 20): blocks = (blocks + [bytearray(1 << 20)])[-40:]"""


class Control:
    """A control group for processes of node a, with a limit of one controller."""

    def __init__(self, controller, limits):
        name = f"ternha-pressure-{os.getpid()}"  # two of these may run, one for each setting
        self.path = Path(f"/sys/fs/cgroup/{controller}") / name
        if not self.path.parent.exists():
            self.path = Path("/sys/fs/cgroup") / name
        self.path.mkdir(exist_ok=True)
        for names, value in limits:
            next(self.path / name for name in names if (self.path / name).exists()).write_text(str(value))

    def add(self, pid):
        (self.path / "cgroup.procs").write_text(str(pid))

    def end(self):
        parent = self.path.parent / "cgroup.procs"
        for pid in (self.path / "cgroup.procs").read_text().split():
            try:
                parent.write_text(pid)
            except OSError:
                pass  # the process has ended
        eventually(10, lambda: not (self.path / "cgroup.procs").read_text())
        self.path.rmdir()


def nothing(_):
    yield


def busy(watchers):
    """200 busy processes"""
    watchers.cluster.a.start("hogs", "sh", "-c", f"for i in $(seq 200); do ({BUSY}) & done; wait")
    yield


def real_time(watchers):
    """a SCHED_FIFO hog on each processor"""
    for i in range(len(os.sched_getaffinity(0))):
        watchers.cluster.a.start(f"hog {i}", "taskset", "-c", i, "chrt", "-f", "50", "sh", "-c", BUSY)
    yield


def hog_in(watchers, group, script):
    """Run `script` in a control group together with node a's programs."""
    node = watchers.cluster.a
    try:
        for name in watchers.on_a:
            group.add(node.pid(name))
        hog = node.start("hog", "python3", "-c", script, stdin=subprocess.PIPE)
        Path(f"/proc/{hog.pid}/oom_score_adj").write_text("1000")
        group.add(hog.pid)
        hog.stdin.write(b"\n")
        hog.stdin.flush()
        yield
    finally:
        node.kill([name for name in ("hog",) if name in node.processes])
        group.end()


def fork_storm(watchers):
    """fork storm at the limit of processes"""
    return hog_in(watchers, Control("pids", [(["pids.max"], 80)]), FORKS)


def descriptors(watchers):
    """no free descriptors"""
    pids = [watchers.cluster.a.pid(name) for name in watchers.on_a]
    before = [resource.prlimit(pid, resource.RLIMIT_NOFILE) for pid in pids]
    try:
        for pid, (_, hard) in zip(pids, before):
            used = {int(fd.name) for fd in Path(f"/proc/{pid}/fd").iterdir()}
            free = next(number for number in range(len(used) + 1) if number not in used)
            resource.prlimit(pid, resource.RLIMIT_NOFILE, (free, hard))
        yield
    finally:
        for pid, limits in zip(pids, before):
            with suppress(ProcessLookupError):  # the process did not survive
                resource.prlimit(pid, resource.RLIMIT_NOFILE, limits)


def memory(watchers):
    """thrashing memory cgroup"""
    limit = (["memory.limit_in_bytes", "memory.max"], 80 << 20)
    return hog_in(watchers, Control("memory", [limit]), THRASH)


def clock_steps(watchers):
    """wall clock of node a's programs stepped by an hour every second, forward and back"""
    node = watchers.cluster.a
    node.prefix = ["env", f"LD_PRELOAD={PROGRAMS}/stepped_clock.so"]
    restart(watchers)
    node.prefix = []
    watchers.wait_until_alive()
    step = "while :; do touch /run/stepped-clock; sleep 1; rm /run/stepped-clock; sleep 1; done"
    node.start("steps", "sh", "-c", step)
    try:
        yield
    finally:
        node.kill(["steps"])
        node.path("/run/stepped-clock").unlink(missing_ok=True)
        restart(watchers)


def restart(watchers):
    """Restart node a's programs."""
    for watcher in watchers.on_a.values():
        watcher.end()
    watchers.start("a")


def on_own_disk(watchers, directory, fail, repair):
    """Restart node a's programs with `directory` on a small disk and make that disk fail."""
    node = watchers.cluster.a
    for watcher in watchers.on_a.values():
        watcher.end()
    image, mount = node.path("/mnt/disk"), node.path(directory)
    with open(image, "wb") as file:
        file.truncate(16 << 20)
    node.run("mkfs.ext4", "-q", "/mnt/disk")
    mount.mkdir(parents=True, exist_ok=True)
    node.run("mount", "-o", "loop", "/mnt/disk", directory)
    node.run("chmod", "700", directory)
    watchers.start("a")
    watchers.wait_until_alive()
    node.run(*fail)
    try:
        yield
    finally:
        # A frozen disk would outlive its namespace, and so would processes that block on it.
        node.run(*repair)
        for watcher in watchers.on_a.values():
            watcher.end()
        eventually(10, lambda: subprocess.run(node.command("umount", directory), check=False,
                                              stderr=subprocess.DEVNULL).returncode == 0, 0.2)
        watchers.start("a")


def frozen(directory):
    def condition(watchers):
        return on_own_disk(watchers, directory, ["fsfreeze", "-f", directory],
                                    ["fsfreeze", "-u", directory])

    return condition


def full(directory):
    def condition(watchers):
        fill = ["sh", "-c", f"dd if=/dev/zero of={directory}/filler bs=64k 2>/dev/null || true"]
        return on_own_disk(watchers, directory, fill, ["rm", "-f", f"{directory}/filler"])

    return condition


def flood(sender):
    def condition(watchers):
        node = getattr(watchers.cluster, sender)
        node.start("flood", "python3", "-c", FLOOD, watchers.cluster.a.address)
        try:
            yield
        finally:
            # It may have ended with its node.
            node.kill([name for name in ("flood",) if name in node.processes])

    return condition


def stop_for(seconds):
    def condition(watchers):
        names = list(watchers.on_a)
        watchers.cluster.a.signal(signal.SIGSTOP, names)
        time.sleep(seconds)  # the pressure itself
        watchers.cluster.a.signal(signal.SIGCONT, names)
        yield

    return condition


CONDITIONS = {
    "none": nothing,
    "200 busy processes": busy,
    "SCHED_FIFO hogs": real_time,
    "fork storm": fork_storm,
    "no descriptors": descriptors,
    "memory thrashed": memory,
    "log disk frozen": frozen("/var/log/ha"),
    "/tmp/ha frozen": frozen("/tmp/ha"),
    "log disk full": full("/var/log/ha"),
    "/tmp/ha full": full("/tmp/ha"),
    "flood from the peer": flood("b"),
    "flood from another": flood("c"),
    "stopped for 2 s": stop_for(2),
    "stopped for 5 s": stop_for(5),
    "stopped for 60 s": stop_for(60),
    "clock steps": clock_steps,
}
SHORT = ["200 busy processes", "no descriptors", "/tmp/ha frozen", "flood from another", "stopped for 2 s"]


RESTARTED = ("frozen", "full", "clock")  # conditions that restart node a's programs


def press(watchers, condition, seconds):
    """Return a cell for each program, and whether ternhad made no mistake.

    A cell has the false positives on both nodes and the detection time of node b's failure.
    """
    watchers.revive()
    # Node b is right when it declares a stopped node a dead.
    observers = [watchers.on_a] if condition.startswith("stopped") else [watchers.on_a, watchers.on_b]
    times_dead = lambda: {name: sum(side[name].times_dead() for side in observers) for name in watchers.on_a}
    with closing(CONDITIONS[condition](watchers)) as steps:
        before = times_dead()
        next(steps)
        if any(word in condition for word in RESTARTED):
            before = times_dead()
        time.sleep(seconds)
        wrong = {name: count - before[name] for name, count in times_dead().items()}
        seeing = watchers.wait_until_alive(20)
        # SIGKILL acts at once; real-time hogs delay the end of a link, and SIGSTOP, by seconds.
        failure = killed(watchers)
        begin = time.monotonic()
        next(failure)
        delays = watchers.detect(seeing, begin, limit=20)
    for node in (watchers.cluster.a, watchers.cluster.c):
        node.kill([name for name in node.processes if name not in watchers.on_a])
    next(failure, None)
    if None in delays.values():  # a program that detected nothing may not recover
        watchers.end()
        watchers.start()
    cells = [f"{count}, {cell(name, delays)}" for name, count in wrong.items()]
    return cells, wrong["ternhad"] == 0 and delays["ternhad"] is not None


def cell(name, delays):
    if name not in delays:
        return "blind"  # it considered its peer dead before the failure
    return "never" if delays[name] is None else format(delays[name], ".2f")


def main():
    parser = argparse.ArgumentParser(prog="script/pressure", description=__doc__)
    parser.add_argument("--build", type=Path, required=True, help=argparse.SUPPRESS)
    parser.add_argument("--short", action="store_true", help="a minute, ternhad alone; fail on a false positive")
    duration = parser.add_mutually_exclusive_group()
    duration.add_argument("--seconds", type=float, default=300, help="duration of each condition (300)")
    duration.add_argument("--minutes", type=float, help="the same in minutes")
    parser.add_argument("--condition", action="append", choices=CONDITIONS, help="only these conditions")
    parser.add_argument("--setting", action="append", choices=["default", "fast"], help="only these settings")
    parser.add_argument("--detection", type=int, metavar="TIMES", help="measure detection without pressure")
    parser.add_argument("--alone", action="store_true", help="without keepalived and corosync")
    options = parser.parse_args()
    require_root()
    # Measure punctually under any pressure; children have normal priority.
    os.sched_setscheduler(0, os.SCHED_RR | os.SCHED_RESET_ON_FORK, os.sched_param(99))
    settings = options.setting or (["fast"] if options.short else ["default", "fast"])
    rivals = not (options.short or options.alone)
    cluster = Cluster(options.build)
    try:
        if options.detection:
            return measure(cluster, options.detection, settings, rivals)
        seconds = 5 if options.short else options.minutes * 60 if options.minutes else options.seconds
        print(f"False positives in {seconds:g} s, and seconds until a real failure is detected", flush=True)
        is_right = True
        for setting in settings:
            watchers = Watchers(cluster, setting, rivals)
            watchers.start()
            print(table_head(setting, watchers.on_a), flush=True)
            for condition in options.condition or (SHORT if options.short else CONDITIONS):
                try:
                    cells, was_right = press(watchers, condition, seconds)
                except (RuntimeError, OSError, subprocess.CalledProcessError) as error:
                    cells, was_right = [f"not measured: {error}"] + ["-"] * (len(watchers.on_a) - 1), False
                    for node in (cluster.a, cluster.b, cluster.c):
                        node.kill()
                    watchers.end()
                    watchers.start()
                print(table_row(condition, cells), flush=True)
                is_right = is_right and was_right
            watchers.end()
        return 0 if is_right else 1
    finally:
        cluster.end()


sys.exit(main())
