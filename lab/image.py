"""The images of a node: kernel and initramfs."""

import gzip
import hashlib
import re
import stat
from pathlib import Path

from failure import LabError

GUEST = Path(__file__).parent / "guest"
LIBRARIES = "usr/lib/arm-linux-gnueabihf"

# Commands provided by busybox; programs that ternhad and the checks call are Debian's.
APPLETS = """
    base64 cat chmod cp date dd dmesg echo grep head hostname id insmod ip kill ln ls mkdir mount mv pidof printf
    readlink rm sed sleep sort sync tail test touch true umount uname uptime wc
""".split()

PROGRAMS = {
    "busybox-static": ["bin/busybox"],
    "coreutils": ["bin/df"],
    "dash": ["bin/dash"],
    "drbd-utils": [
        "lib/drbd/drbdadm-84", "lib/drbd/drbdsetup-84", "sbin/drbdadm", "sbin/drbdmeta", "sbin/drbdsetup",
    ],
    "iputils-ping": ["bin/ping"],
    "mdadm": ["sbin/mdadm"],
    "net-tools": ["sbin/ifconfig"],
    "procps": ["bin/ps"],
    "xz-utils": ["usr/bin/xz"],
}

MODULES = [
    "virtio_mmio", "virtio_net", "virtio_blk", "virtio_console", "virtio-rng", "crc32c_generic", "ext4", "drbd",
    "raid1",
]


class Archive:
    """A cpio archive for the kernel; root owns all files."""

    def __init__(self):
        self._data = bytearray()
        self._directories = set()
        self._count = 0

    def directory(self, path: str, mode: int = 0o755):
        if path in ("", ".") or path in self._directories:
            return
        self.directory(str(Path(path).parent))
        self._directories.add(path)
        self._add(path, stat.S_IFDIR | mode, b"")

    def file(self, path: str, content: bytes, mode: int = 0o644):
        self.directory(str(Path(path).parent))
        self._add(path, stat.S_IFREG | mode, content)

    def link(self, path: str, target: str):
        self.directory(str(Path(path).parent))
        self._add(path, stat.S_IFLNK | 0o777, target.encode())

    def compressed(self) -> bytes:
        self._add("TRAILER!!!", 0, b"")
        return gzip.compress(bytes(self._data), compresslevel=1, mtime=0)

    def _add(self, path: str, mode: int, content: bytes):
        self._count += 1
        name = path.encode() + b"\0"
        fields = (self._count, mode, 0, 0, 1, 0, len(content), 0, 0, 0, 0, len(name), 0)
        self._data += b"070701" + b"".join(b"%08x" % field for field in fields) + name
        self._pad()
        self._data += content
        self._pad()

    def _pad(self):
        self._data += bytes(-len(self._data) % 4)


def kernel(packages: Path) -> Path:
    (image,) = (packages / "kernel/boot").glob("vmlinuz-*")
    return image


def system(packages: Path, cache: Path) -> bytes:
    """Return the compressed archive of all but the programs under test; rebuilt after changes."""
    digest = hashlib.sha256()
    for source in [Path(__file__), packages / "complete", *sorted(GUEST.iterdir())]:
        digest.update(source.read_bytes())
    cached = cache / f"system-{digest.hexdigest()[:16]}.gz"
    if not cached.exists():
        for old in cache.glob("system-*.gz"):
            old.unlink()
        cached.write_bytes(_system(packages))
    return cached.read_bytes()


def programs(build: Path) -> bytes:
    """Return the compressed archive of the programs under test and the lab tool."""
    archive = Archive()
    for source, target in {
        "daemon/ternhad": "usr/sbin/ternhad",
        "cli/ternhactl": "usr/bin/ternhactl",
        "src/libternhadaemon.so.6": f"{LIBRARIES}/libternhadaemon.so.6",
        "platform/libterncore.so.6": f"{LIBRARIES}/libterncore.so.6",
        "lab/ternha-lab-tool": "usr/bin/ternha-lab-tool",
    }.items():
        archive.file(target, (build / source).read_bytes(), 0o755)
    return archive.compressed()


def _system(packages: Path) -> bytes:
    archive = Archive()
    for path in ("dev", "etc/ternha", "proc", "root", "run", "sys", "tmp", "usr/sbin", "var/lib/drbd"):
        archive.directory(path)
    archive.directory("var/log/ha", 0o700)
    for name in ("bin", "lib", "sbin"):
        archive.link(name, f"usr/{name}")
    archive.link("var/run", "/run")
    archive.link("var/lock", "/run/lock")

    for package, paths in PROGRAMS.items():
        for path in paths:
            target = path if path.startswith("usr/") else f"usr/{path}"
            archive.file(target, (packages / package / path).read_bytes(), 0o755)
    archive.link("usr/bin/sh", "dash")  # busybox's shell would prefer its own ps, df, ping and xz
    for applet in APPLETS:
        archive.link(f"usr/bin/{applet}", "busybox")
    _add_libraries(archive, packages)
    _add_modules(archive, packages)

    archive.file("init", (GUEST / "init").read_bytes(), 0o755)
    for name in ("channel", "supervisor"):
        archive.file(f"usr/lib/lab/{name}", (GUEST / name).read_bytes(), 0o755)
    archive.file("etc/drbd.conf", (GUEST / "drbd.conf").read_bytes())
    return archive.compressed()


def _add_libraries(archive: Archive, packages: Path):
    for directory in ("lib/arm-linux-gnueabihf", LIBRARIES):
        for library in sorted(packages.glob(f"*/{directory}/*.so*")):
            target = f"{LIBRARIES}/{library.name}"
            if library.is_symlink():
                archive.link(target, library.readlink().name)
            else:
                archive.file(target, library.read_bytes(), 0o755)
    archive.link("usr/lib/ld-linux-armhf.so.3", "arm-linux-gnueabihf/ld-linux-armhf.so.3")


def _add_modules(archive: Archive, packages: Path):
    """Add the modules with their dependencies, and the list of their paths in load order."""
    files = {path.stem.replace("-", "_"): path for path in packages.glob("kernel/lib/modules/**/*.ko")}
    order: list[str] = []

    def add(name: str):
        if name not in files:
            raise LabError(f"the kernel package has no module {name}")
        path = f"usr/lib/modules/{name}.ko"
        if path in order:
            return
        content = files[name].read_bytes()
        needs = re.search(rb"\0depends=([^\0]*)\0", content)
        for needed in filter(None, needs.group(1).decode().split(",") if needs else []):
            add(needed.replace("-", "_"))
        order.append(path)
        archive.file(path, content)

    for module in MODULES:
        add(module.replace("-", "_"))
    archive.file("usr/lib/modules/order", "".join(f"/{path}\n" for path in order).encode())
