"""Run the lab: two emulated nodes and a scenario."""

import argparse
import fcntl
import shutil
import signal
import subprocess
import sys
import tempfile
import time
import traceback
from pathlib import Path

import scenario
from checks import Checks
from consoles import Consoles
from failure import CheckFailed, LabError
from lab import INTERRUPTIONS, Lab
from node import Channel
from repack import two_versions

ROOT = Path(__file__).resolve().parents[1]
BUILD = ROOT / "build/lab"
PACKAGES = ROOT / "build/packages"


def main() -> int:
    options = parse_options()
    for number in INTERRUPTIONS:
        signal.signal(number, interrupt)
    try:
        if options.on:
            return run_on_node(Path(options.on), " ".join(options.command))
        return run_lab(options.keep)
    except LabError as error:
        print(f"lab: {error}", file=sys.stderr)
        return 1
    except KeyboardInterrupt:
        print("lab: interrupted", file=sys.stderr)
        return 130


def parse_options():
    parser = argparse.ArgumentParser(prog="script/lab", description="Two emulated 32-bit ARM nodes at work.")
    parser.add_argument("--keep", action="store_true", help="keep both nodes running until Ctrl-C")
    parser.add_argument("--on", metavar="NODE", help="run a command on a kept node; --keep prints its path")
    parser.add_argument("command", nargs=argparse.REMAINDER, help="the command for --on")
    options = parser.parse_args()
    if bool(options.on) != bool(options.command):
        parser.error("--on NODE and a command go together")
    return options


def interrupt(number, _frame):
    raise KeyboardInterrupt(number)


def run_lab(keep: bool) -> int:
    BUILD.mkdir(parents=True, exist_ok=True)
    with tempfile.TemporaryDirectory(prefix="ternha-packages.") as directory:
        with open(BUILD / "lock", "w") as lock:
            fcntl.flock(lock, fcntl.LOCK_EX)  # runs side by side share what they are made from
            make_packages(Path(directory))
        image = Path(make("image", ROOT / "lab/debian-image", shown=sys.stderr).strip())
        return run_nodes(image, Path(directory), keep)


def run_nodes(image: Path, packages: Path, keep: bool) -> int:
    begin = time.monotonic()
    consoles = Consoles(BUILD / "consoles", begin)
    checks = Checks(consoles, begin)
    print(f"lab: the consoles of both nodes go to {consoles.path.relative_to(ROOT)}", flush=True)
    failed = False
    with Lab(image, packages, consoles) as lab:
        try:
            scenario.run(lab, checks)
        except Exception as failure:
            failed = True
            report(failure, consoles)
        verdict = "1 failed, the rest not reached" if failed else "0 failed"
        print(f"lab: {checks.passed} checks passed, {verdict}, in {checks.elapsed():.1f} s", flush=True)
        if keep:
            leave_up(lab)
    return 1 if failed else 0


def make_packages(directory: Path):
    """Two versions of the packages, and the lab's own tool."""
    make("packages", ROOT / "script/package", "armhf")
    tree = PACKAGES / "build-armhf"
    make("tool", "cmake", "-D", "TERNHA_BUILD_LAB=ON", tree)
    make("tool", "cmake", "--build", tree, "--target", "ternha-lab-tool")
    shutil.copy(tree / "lab/ternha-lab-tool", directory)
    two_versions(PACKAGES, "armhf", directory)


def make(what: str, *command: str | Path, shown=subprocess.PIPE) -> str:
    """Run the command and return its output; `shown` is where its standard error goes."""
    with subprocess.Popen(command, cwd=ROOT, stdout=subprocess.PIPE, stderr=shown, text=True) as process:
        try:
            output, errors = process.communicate()
        except BaseException:
            process.terminate()
            raise
    if process.returncode != 0:
        raise LabError(f"the {what} cannot be made:\n{output}{errors or ''}")
    return output


def report(failure: Exception, consoles: Consoles):
    sys.stdout.flush()
    if isinstance(failure, CheckFailed):
        print(f"FAILED: {failure.what}", file=sys.stderr)
        print(f"  expected: {failure.expected}\n  actual:   {failure.seen}", file=sys.stderr)
        consoles.note(f"FAILED: {failure.what}")
    elif isinstance(failure, LabError):
        print(f"FAILED: {failure}", file=sys.stderr)
    else:
        traceback.print_exception(failure)
    print(f"The last lines of the consoles, all of which are in {consoles.path}:", file=sys.stderr)
    print(consoles.tail(), file=sys.stderr, flush=True)


def leave_up(lab: Lab):
    """Wait for Ctrl-C with the command channels free."""
    print("Both nodes run until Ctrl-C. To run commands on them from another terminal:")
    for node in lab.nodes:
        node.channel.close()
        print(f"  script/lab --on {lab.directory}/{node} ternhactl status", flush=True)
    try:
        while True:
            signal.pause()
    except KeyboardInterrupt:
        print("lab: ended", flush=True)


def run_on_node(node: Path, command: str) -> int:
    channel = Channel(node.name, node)
    code, output = channel.finish(channel.start(command))
    print(output, end="")
    return code


sys.exit(main())
