"""Scenes of the daemon as a service, for any kind of nodes."""

import time
from typing import Callable

import service
from checks import Checks

RETURN_LIMIT = 30  # seconds until both nodes are in normal operation again
STOP_LIMIT = 10
ABORTED = "code=killed, status=6/ABRT"
WATCHDOG = "WatchdogSec=10"  # with it a daemon also ends when its peer is silent for some 7 seconds


def kill(lab, checks: Checks, well: dict):
    checks.scene("The daemon of node-b is killed")
    times_dead, ends = service.times_dead(lab), service.ends(lab.b)
    lab.b.run("systemctl kill --signal=KILL ternhad")
    check_restarted(lab, checks, [*ends, "code=killed, status=9/KILL"], well)
    checks.equal("neither node has declared its peer dead", times_dead, service.times_dead(lab))


def unknown_request(lab, checks: Checks, well: dict):
    checks.scene("node-a sends node-b an unknown request")
    times_dead, ends = service.times_dead(lab), service.ends(lab.b)
    send(lab, "no_such_request")
    check_restarted(lab, checks, [*ends, ABORTED], well)
    checks.equal("neither node has declared its peer dead", times_dead, service.times_dead(lab))


def hung_thread(lab, checks: Checks, well: dict, release: Callable[[], None]):
    """Expects a drop-in with WATCHDOG that replaces the service's /proc/drbd by a FIFO, so that open()
    blocks; `release` ends that for the next start."""
    checks.scene("A thread of node-b's daemon hangs")
    times_dead, ends = service.times_dead(lab), service.ends(lab.b)
    lab.b.run("systemctl restart ternhad")
    release()
    check_restarted(lab, checks, [*ends, ABORTED], well)
    watchdog = lab.b.run("journalctl --unit=ternhad --output=cat | grep -c 'Watchdog timeout'").strip()
    checks.equal("by the watchdog", "1", watchdog)
    checks.equal("neither node has declared its peer dead", times_dead, service.times_dead(lab))


def reload(lab, checks: Checks):
    checks.scene("The service is reloaded")
    before = lab.b.log()
    pid = service.pid(lab.b)
    archive = "/var/log/ha/ha.daemon.log.0.xz"
    lab.b.run("systemctl reload ternhad")
    checks.within(RETURN_LIMIT, "the log is moved and archived",
                  lambda: lab.b.try_run(f"xz --decompress --stdout {archive}")[1].splitlines()[: len(before)], before)
    checks.equal("by the same daemon", pid, service.pid(lab.b))


def stop(lab, checks: Checks, well: dict):
    checks.scene("The service is stopped")
    before = lab.b.log()
    begin = time.monotonic()
    lab.b.run("systemctl stop ternhad")
    took = time.monotonic() - begin
    checks.that(f"it has stopped within its time ({took:.1f} s)", took < STOP_LIMIT, f"less than {STOP_LIMIT} s", took)
    checks.equal("cleanly", ["inactive", "success"], service.properties(lab.b, "ActiveState", "Result"))
    on_disk = lab.b.run("cat /var/log/ha/ha.daemon.log").splitlines()
    checks.equal("its log is on the disk", before, on_disk[: len(before)])
    checks.equal("and nowhere else", "", lab.b.run("cat /tmp/ha/ha.daemon.log 2>/dev/null || true"))
    lab.b.run("systemctl start ternhad")
    checks.within(RETURN_LIMIT, "after the start both are in normal operation", lab.statuses, [well] * 2)


def upgrade(lab, checks: Checks, well: dict, command: str):
    checks.scene("Rolling upgrade: node-a, then node-b")
    times_dead = service.times_dead(lab)
    for node in lab.nodes:
        old_version, starts, configuration = service.installation(node)
        node.run(command, 300)
        version, new_starts, new_configuration = service.installation(node)
        checks.that(f"{node} has another version", version != old_version, f"not {old_version}", version)
        checks.equal("its edited configuration is kept", configuration, new_configuration)
        checks.equal("the daemon was restarted once", starts + 1, new_starts)
        checks.within(RETURN_LIMIT, "both are in normal operation again", lab.statuses, [well] * 2)
    checks.equal("neither node has declared its peer dead", times_dead, service.times_dead(lab))


def send(lab, request: str):
    """Send a datagram from node-a to the port of node-b."""
    lab.a.run(f"bash -c 'printf {request} >/dev/udp/{lab.b.address}/7499'")


def check_restarted(lab, checks: Checks, ends: list[str], well: dict):
    """Check that the daemon of node-b failed in the last of these ways and was restarted."""
    def look() -> tuple[list[str], str]:
        state = service.state(lab.b)
        if state != "active":
            return [], state  # journalctl would slow its start down
        return service.ends(lab.b), service.state(lab.b)

    checks.within(RETURN_LIMIT, f"it ends ({ends[-1].rpartition('/')[2]}) and is restarted", look, (ends, "active"))
    checks.within(RETURN_LIMIT, "both are in normal operation again", lab.statuses, [well] * 2)
