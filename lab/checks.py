"""Checks of a scenario: print a line for each that passes, stop at the first that fails."""

import time
from typing import Any, Callable

from consoles import Consoles
from failure import CheckFailed

POLL = 0.2  # seconds between two polls: an emulated processor needs as long for one
LONGEST = 3000  # characters of the expected and the actual state that a failed run prints


class Checks:
    def __init__(self, consoles: Consoles, begin: float):
        self._consoles = consoles
        self._begin = begin
        self.passed = 0

    def elapsed(self) -> float:
        return time.monotonic() - self._begin

    def scene(self, title: str):
        print(f"== {title}", flush=True)
        self._consoles.note(f"== {title}")

    def fact(self, text: str):
        """Print information that is not checked."""
        self._line("      ", text)

    def that(self, what: str, holds: bool, expected: Any, seen: Any):
        if not holds:
            raise CheckFailed(what, describe(expected), describe(seen))
        self.passed += 1
        self._line("ok    ", what)

    def equal(self, what: str, expected: Any, seen: Any):
        self.that(what, expected == seen, expected, seen)

    def within(self, limit: float, what: str, look: Callable[[], Any], expected: Any, since: float | None = None):
        """Poll `look` until it returns what is expected.

        That poll must begin at most `limit` seconds after `since` (default: now); its own duration
        does not count. `expected` is a value, the relevant members of the record of each node, or a
        predicate whose docstring describes it.
        """
        start = time.monotonic() if since is None else since
        while True:
            begin_look = time.monotonic()
            seen = look()
            if begin_look - start > limit:
                raise CheckFailed(what, f"within {limit} s: {describe(expected)}", describe(seen))
            if matches(seen, expected):
                self.passed += 1
                return self._line("ok    ", f"{what} ({time.monotonic() - start:.1f} s)")
            time.sleep(POLL)

    def holds(self, duration: float, what: str, look: Callable[[], Any], expected: Any):
        """Poll `look` for `duration` seconds; each poll must return what is expected."""
        start = time.monotonic()
        looks = 0
        while looks < 3 or time.monotonic() - start < duration:
            seen = look()
            looks += 1
            if not matches(seen, expected):
                raise CheckFailed(what, f"for {duration} s: {describe(expected)}", describe(seen))
        self.passed += 1
        self._line("ok    ", f"{what} ({looks} polls in {time.monotonic() - start:.1f} s)")

    def _line(self, mark: str, text: str):
        print(f"{mark}{self.elapsed():6.1f} s  {text}", flush=True)
        self._consoles.note(f"{mark}{text}")


def matches(seen: Any, expected: Any) -> bool:
    if callable(expected):
        return expected(seen)
    if isinstance(expected, list) and isinstance(seen, list):
        return len(seen) == len(expected) and all(map(matches, seen, expected))
    if isinstance(expected, dict) and isinstance(seen, dict):
        return all(name in seen and seen[name] == value for name, value in expected.items())
    return seen == expected


def describe(value: Any) -> str:
    text = value.__doc__ if callable(value) else str(value)
    return text if len(text) <= LONGEST else f"... {text[-LONGEST:]}"
