"""Two versions of the packages, for upgrades."""

import shutil
import subprocess
import tempfile
from pathlib import Path

from failure import LabError
from service import PACKAGES

SCRIPT = """
    dpkg-deb --raw-extract "$1" "$3/package"
    sed -i "s/^\\(Version: .*\\)-[^-]*$/\\1-0/" "$3/package/DEBIAN/control"
    dpkg-deb --root-owner-group -Znone --build "$3/package" "$2"
"""


def two_versions(built: Path, architecture: str, directory: Path):
    """Copy the packages to `new`, and with a lower version to `old`."""
    for age in ("new", "old"):
        (directory / age).mkdir()
    for name in PACKAGES:
        (package,) = built.glob(f"{name}_*_{architecture}.deb")
        shutil.copy(package, directory / "new")
        repack(package, directory / "old" / package.name)


def repack(package: Path, target: Path):
    """Build the same package with a lower Debian revision."""
    with tempfile.TemporaryDirectory() as unpacked:
        command = ["sh", "-ec", SCRIPT, "repack", package, target, unpacked]
        result = subprocess.run(command, capture_output=True, text=True, check=False)
    if result.returncode != 0:
        raise LabError(f"{package} cannot be repacked: {result.stderr}")
