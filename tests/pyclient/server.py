"""The real cvdbserver as a child process, for the tests of the Python client.

The server runs with a temporary home (its database root is home/db/, where
config.json is written), a log folder of its own and --console, and lets the
system choose its port (ServerPort 0); the port is read from the line
"Listening on port N" that it writes when it listens. A thread collects
every line it writes.
"""

from __future__ import annotations

import json
import os
import re
import shutil
import signal
import subprocess
import tempfile
import threading
from typing import Optional

_LISTENING = re.compile(r"Listening on port ([0-9]+)")


class ServerProcess:
    def __init__(self, binary: str, config: Optional[dict] = None, start_timeout: float = 30.0):
        self.dir = tempfile.mkdtemp(prefix="cvdb-pyclient-")
        self.home = os.path.join(self.dir, "home")
        self.db_root = os.path.join(self.home, "db")
        self.log_dir = os.path.join(self.dir, "log")
        os.makedirs(self.db_root)
        settings = {"ServerPort": 0}
        settings.update(config or {})
        with open(os.path.join(self.db_root, "config.json"), "w") as f:
            json.dump(settings, f)
        self.backup_folder = settings.get("BackupFolder") or os.path.join(self.db_root, "db.backup")

        self._lines: list[str] = []
        self._ended = False
        self._changed = threading.Condition()
        self.port: Optional[int] = None
        self.process = subprocess.Popen(
            [binary, "--home", self.home, "--log-dir", self.log_dir, "--console"],
            stdin=subprocess.DEVNULL,
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
        )
        self._reader = threading.Thread(target=self._read_output, daemon=True)
        self._reader.start()
        try:
            line = self.wait_for_line(_LISTENING.pattern, start_timeout, regex=True)
        except Exception:
            self.stop(signal.SIGKILL)
            raise
        if line is None:
            self.stop(signal.SIGKILL)
            raise RuntimeError("the server did not listen; its output:\n" + "\n".join(self.lines()))
        self.port = int(_LISTENING.search(line).group(1))

    def _read_output(self) -> None:
        for raw in self.process.stdout:
            with self._changed:
                self._lines.append(raw.decode("utf-8", "replace").rstrip("\n"))
                self._changed.notify_all()
        with self._changed:
            self._ended = True
            self._changed.notify_all()

    def lines(self) -> list[str]:
        with self._changed:
            return list(self._lines)

    def wait_for_line(self, fragment: str, timeout: float = 20.0, regex: bool = False) -> Optional[str]:
        """The first line containing the fragment (also one written before
        the call); None when the output ends or the time runs out first."""
        found: list[str] = []

        def seen() -> bool:
            for line in self._lines:
                if (re.search(fragment, line) if regex else fragment in line):
                    found.append(line)
                    return True
            return self._ended

        with self._changed:
            self._changed.wait_for(seen, timeout)
        return found[0] if found else None

    def stop(self, sig: int = signal.SIGTERM, timeout: float = 30.0) -> int:
        """Signals the server and returns its exit status (-N for signal N)."""
        if self.process.poll() is None:
            self.process.send_signal(sig)
        try:
            status = self.process.wait(timeout)
        except subprocess.TimeoutExpired:
            self.process.kill()
            status = self.process.wait()
        self._reader.join(10)
        self.process.stdout.close()
        return status

    def remove(self) -> None:
        shutil.rmtree(self.dir, ignore_errors=True)
