"""Run the scenario of the service: run_containers.py ROOT PACKAGES, in private namespaces."""

import signal
import sys
import tempfile
import time
from pathlib import Path

import container_scenario
from checks import Checks
from consoles import Consoles
from containers import Containers
from failure import CheckFailed, LabError
from repack import two_versions

ROOT = Path(__file__).resolve().parents[1]


def main() -> int:
    root, built = sys.argv[1], Path(sys.argv[2])
    for number in (signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, signal.default_int_handler)
    begin = time.monotonic()
    consoles = Consoles(ROOT / "build/containers", begin)
    checks = Checks(consoles, begin)
    print(f"containers: the consoles of both nodes go to {consoles.path.relative_to(ROOT)}", flush=True)
    failed = False
    try:
        with tempfile.TemporaryDirectory(prefix="ternha-containers.") as directory:
            two_versions(built, "amd64", Path(directory))
            with Containers(root, Path(directory), consoles) as pair:
                container_scenario.run(pair, checks)
    except CheckFailed as failure:
        failed = True
        print(f"FAILED: {failure.what}\n  expected: {failure.expected}\n  actual:   {failure.seen}", flush=True)
    except LabError as error:
        failed = True
        print(f"FAILED: {error}", flush=True)
    except KeyboardInterrupt:
        print("containers: interrupted", file=sys.stderr)
        return 130
    if failed:
        print(f"The last lines of the consoles, all of which are in {consoles.path}:\n{consoles.tail()}", flush=True)
    print(f"containers: {checks.passed} passed, {int(failed)} failed", flush=True)
    return int(failed)


sys.exit(main())
