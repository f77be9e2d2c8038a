"""Collect the consoles of both nodes in one file, line by line."""

import socket
import threading
import time
from collections import deque
from pathlib import Path

TAIL = 25  # lines of each console that a failed run prints
KEPT_FILES = 10


class Consoles:
    def __init__(self, directory: Path, begin: float):
        directory.mkdir(parents=True, exist_ok=True)
        for old in sorted(directory.glob("*.log"), key=lambda path: path.stat().st_mtime)[: 1 - KEPT_FILES]:
            old.unlink(missing_ok=True)
        stamp = time.strftime("%Y%m%d-%H%M%S")
        self._file = open(directory / f"{stamp}-{threading.get_native_id()}.log", "w", buffering=1)
        self.path = Path(self._file.name)
        self._begin = begin
        self._lock = threading.Lock()
        self._tails: dict[str, deque[str]] = {}

    def follow(self, name: str, console: socket.socket):
        """Copy a node's console until its emulator exits."""
        self._tails[name] = deque(maxlen=TAIL)
        threading.Thread(target=self._follow, args=(name, console), daemon=True).start()

    def note(self, text: str):
        """Add a line of the scenario."""
        self._write(f"-- {text}")

    def tail(self) -> str:
        with self._lock:
            return "\n".join(line for lines in self._tails.values() for line in lines)

    def _follow(self, name: str, console: socket.socket):
        with console, console.makefile("r", errors="replace") as lines:
            for line in lines:
                self._write(f"{name}| {line.rstrip()}", name)

    def _write(self, text: str, name: str = ""):
        with self._lock:
            line = f"{time.monotonic() - self._begin:6.1f} {text}"
            print(line, file=self._file)
            if name:
                self._tails[name].append(line)
