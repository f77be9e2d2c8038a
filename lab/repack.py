"""Packages of another version, for upgrades."""

import subprocess
from pathlib import Path

from failure import LabError

SCRIPT = """
    unpacked=$(mktemp -d)
    trap 'rm -r "$unpacked"' EXIT
    dpkg-deb --raw-extract "$1" "$unpacked/package"
    sed -i "s/^\\(Version: .*\\)-[^-]*$/\\1-$3/" "$unpacked/package/DEBIAN/control"
    dpkg-deb --root-owner-group -Znone --build "$unpacked/package" "$2"
"""


def repack(package: Path, target: Path, revision: int):
    """Build the same package with another Debian revision."""
    command = ["sh", "-ec", SCRIPT, "repack", package, target, str(revision)]
    result = subprocess.run(command, capture_output=True, text=True, check=False)
    if result.returncode != 0:
        raise LabError(f"{package} cannot be repacked: {result.stderr}")
