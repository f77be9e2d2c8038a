"""The daemon as a systemd service of a node."""

from pathlib import Path

from node import FULL_LOG, Node
from node_pair import NodePair

FILE = "/etc/ternha/ternhad.conf"
DROP_IN = "/run/systemd/system/ternhad.service.d/lab.conf"
LASTING_DROP_IN = "/etc/systemd/system/ternhad.service.d/lab.conf"  # survives a reboot
ENDS = "journalctl --unit=ternhad --output=cat | grep 'Main process exited' || true"
PACKAGES = ["libterncore6", "libternhadaemon6", "ternhad"]


def configure(node: Node, peer: Node, interface: str, **others):
    """Edit the configuration as an administrator does."""
    values = {"local-ip": node.address, "remote-ip": peer.address, "interface": interface} | others
    edits = " ".join(f"-e 's/^#{key} = .*/{key} = {value}/'" for key, value in values.items())
    node.run(f"sed -i {edits} {FILE}")


def properties(node: Node, *names: str) -> list[str]:
    lines = node.run(f"systemctl show ternhad --property={','.join(names)}").splitlines()
    values = dict(line.split("=", 1) for line in lines)
    return [values[name] for name in names]


def state(node: Node) -> str:
    return properties(node, "ActiveState")[0]


def pid(node: Node) -> int:
    return int(properties(node, "MainPID")[0])


def restarts(node: Node) -> int:
    """Return the number of automatic restarts."""
    return int(properties(node, "NRestarts")[0])


def installation(node: Node) -> tuple[str, int, str]:
    """Return the version of the package, how often the daemon was started, and its configuration."""
    output = node.run(
        "dpkg-query --show --showformat='${Version}\\n' ternhad;"
        " journalctl --unit=ternhad --output=cat | grep --count '^Started ' || true;"
        f" cat {FILE}"
    )
    version, starts, configuration = output.split("\n", 2)
    return version, int(starts), configuration


def ends(node: Node) -> list[str]:
    """Return how the main process ended in each failure."""
    return [line.partition("exited, ")[2] for line in node.run(ENDS).splitlines()]


def override(node: Node, *settings: str):
    """Add a drop-in to the unit, or remove it."""
    prepare_override(node, DROP_IN, *settings)
    node.run("systemctl daemon-reload")


def prepare_override(node: Node, path: str, *settings: str):
    """Write a drop-in, or remove it; it takes effect when systemd is reloaded or started."""
    lines = "\\n".join(["[Service]", *settings])
    node.run(f"mkdir -p {Path(path).parent} && printf '{lines}\\n' >{path}" if settings else f"rm -f {path}")


def times_dead(pair: NodePair) -> list[int]:
    """Return how often each node declared its peer dead."""
    return [output.count(" Remote server status changed to dead\n") for output in pair.run(FULL_LOG)]
