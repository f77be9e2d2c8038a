"""Measure the detection time of a failed peer by ternhad, keepalived and corosync side by side."""

import random
import signal
import statistics
import time

from nodes import Daemon, eventually
from rivals import Corosync, Keepalived

# Name: options of ternhad, advertisement interval of keepalived in seconds, token timeout of
# corosync in milliseconds (0: its default).
SETTINGS = {
    "default": ([], 1, 0),
    "fast": (["--dead-after", "0.5", "--check-interval", "0.1"], 0.1, 500),
}
LIMIT = 60  # seconds


class Watchers:
    """The programs of both nodes with one setting; each monitors the other node."""

    def __init__(self, cluster, setting, rivals=True):
        options, interval, token = SETTINGS[setting]
        self.cluster = cluster
        self.on_a = {"ternhad": Daemon(cluster.a, "b", options)}
        self.on_b = {"ternhad": Daemon(cluster.b, "a", options)}
        if rivals:
            self.on_a |= {"keepalived": Keepalived(cluster.a, interval, 100),
                          "corosync": Corosync(cluster.a, token)}
            self.on_b |= {"keepalived": Keepalived(cluster.b, interval, 200),
                          "corosync": Corosync(cluster.b, token)}

    def start(self, nodes="ab"):
        for node, watchers in (("a", self.on_a), ("b", self.on_b)):
            if node in nodes:
                for watcher in watchers.values():
                    watcher.start()

    def wait_until_alive(self, limit=LIMIT):
        """Return the programs on node a that report their peer alive; fail if ternhad does not."""
        eventually(limit, lambda: all(watcher.sees_peer() for watcher in self.on_a.values()), 0.1)
        seeing = [name for name, watcher in self.on_a.items() if watcher.sees_peer()]
        if "ternhad" not in seeing:
            raise RuntimeError("ternhad does not report its peer alive")
        return seeing

    def revive(self):
        """Restart all programs if one of those on node a considers its peer dead."""
        if len(self.wait_until_alive()) < len(self.on_a):
            self.end()
            self.start()
            self.wait_until_alive()

    def detect(self, names, since, limit=LIMIT):
        """Return when each program on node a declared its peer dead.

        In seconds since `since`; None: not within `limit` seconds.
        """
        times = dict.fromkeys(names)
        while None in times.values() and time.monotonic() - since < limit:
            for name in times:
                if times[name] is None and self.on_a[name].sees_peer() is False:
                    times[name] = time.monotonic() - since
            time.sleep(0.003)
        return times

    def end(self):
        for watchers in (self.on_a, self.on_b):
            for watcher in watchers.values():
                watcher.end()


def cut(watchers):
    watchers.cluster.set_link(watchers.cluster.b, False)
    yield
    watchers.cluster.set_link(watchers.cluster.b, True)


def killed(watchers):
    watchers.cluster.b.signal(signal.SIGKILL)
    yield
    watchers.cluster.b.kill()
    watchers.start("b")


def stopped(watchers):
    watchers.cluster.b.signal(signal.SIGSTOP)
    yield
    watchers.cluster.b.signal(signal.SIGCONT)


def vanished(watchers):
    cluster = watchers.cluster
    cluster.unplug(cluster.b)
    yield
    cluster.b.kill()
    cluster.plug(cluster.b)
    watchers.start("b")


FAILURES = {"cut link": cut, "killed": killed, "stopped": stopped, "vanished": vanished}


def table_row(name, cells):
    return f"| {name} | {' | '.join(cells)} |"


def table_head(name, columns):
    return "\n" + table_row(name, columns) + "\n|---|" + "---:|" * len(columns)


def measure(cluster, times, settings, rivals):
    """Print the table, each row as soon as it is measured."""
    print(f"Seconds until detected, {times} times each: minimum, median, maximum", flush=True)
    for setting in settings:
        watchers = Watchers(cluster, setting, rivals)
        watchers.start()
        print(table_head(setting, watchers.on_a), flush=True)
        for name, failure in FAILURES.items():
            results = {program: [] for program in watchers.on_a}
            for _ in range(times):
                watchers.revive()
                time.sleep(random.uniform(2, 4))  # at any phase of the probes
                steps = failure(watchers)
                begin = time.monotonic()
                next(steps)
                for program, seconds in watchers.detect(watchers.on_a, begin).items():
                    results[program].append(LIMIT if seconds is None else seconds)
                next(steps, None)
            cells = [f"{min(r):.2f} {statistics.median(r):.2f} {max(r):.2f}" for r in results.values()]
            print(table_row(name, cells), flush=True)
        watchers.end()
