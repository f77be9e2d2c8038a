"""Debian packages of the nodes, fetched once and kept under build/lab."""

import shutil
import subprocess
from pathlib import Path

from failure import LabError

ARCHITECTURE = "armhf"
KERNEL = "linux-image-armmp"  # depends on the kernel of the day
PACKAGES = [
    "busybox-static", "coreutils", "dash", "drbd-utils", "iputils-ping", "libc6", "libcap2", "libgcc-s1",
    "libgcrypt20", "libgpg-error0", "libidn2-0", "libjsoncpp25", "liblz4-1", "liblzma5", "libproc2-0",
    "libstdc++6", "libsystemd0", "libudev1", "libunistring2", "libzstd1", "mdadm", "net-tools", "procps",
    "xz-utils",
]


def unpacked(cache: Path) -> Path:
    """Return the directory that holds one per package; that of the kernel is named "kernel"."""
    root = cache / "packages"
    done = root / "complete"
    wanted = "\n".join([KERNEL, *PACKAGES]) + "\n"
    if done.exists() and done.read_text() == wanted:
        return root
    shutil.rmtree(root, ignore_errors=True)
    root.mkdir(parents=True)
    print("lab: fetching the nodes' packages (55 MB)", flush=True)
    kernel = _kernel_package()
    for package in [kernel, *PACKAGES]:
        target = root / ("kernel" if package == kernel else package)
        target.mkdir()
        _run(["apt-get", "-q", "download", f"{package}:{ARCHITECTURE}"], target)
        (archive,) = target.glob("*.deb")
        _run(["dpkg", "--extract", archive.name, "."], target)
        archive.unlink()
    done.write_text(wanted)
    return root


def _kernel_package() -> str:
    output = _run(["apt-cache", "depends", f"{KERNEL}:{ARCHITECTURE}"], Path("/"))
    for line in output.splitlines():
        relation, _, package = line.strip().partition(": ")
        if relation == "Depends" and package.startswith("linux-image-"):
            return package.partition(":")[0]
    raise LabError(f"apt knows no {KERNEL}:{ARCHITECTURE}; apt-get update may help")


def _run(command: list[str], directory: Path) -> str:
    result = subprocess.run(command, cwd=directory, capture_output=True, text=True, check=False)
    if result.returncode != 0:
        raise LabError(f"{' '.join(command)} failed; apt-get update may help:\n{result.stderr or result.stdout}")
    return result.stdout
