"""A daemon for tests of programs that report: `kytctl listen` in a process of its own, and what it was told.

With pytest, the fixture of kytreporting.pytest_plugin:

    pytest_plugins = ["kytreporting.pytest_plugin"]

    def test_reports_its_start(kyt_listener):
        run_the_program()
        [message] = kyt_listener.wait_for("message")
        assert (message["category"], message["type"]) == (10, 1)
        assert message["payload"] == {"step": 1}

Needs the program kytctl (package kytreporting-tools).
"""

from __future__ import annotations

import json
import os
import shutil
import subprocess
import tempfile
import threading
import time
from types import TracebackType
from typing import Any, Dict, List, Optional, Type

__all__ = ["Listener"]


class Listener:
    """Stands in for the daemon at `socket_path` until stop() or the end of its with statement.

    live: the live back ends of each session, parted by commas; storebag: whether there is one; refuse: serve nobody;
    die_after: end as if killed after so many messages. `kytctl` is the program, found on the path otherwise.
    """

    def __init__(
        self,
        socket_path: Optional[str] = None,
        *,
        live: str = "httppost",
        storebag: bool = True,
        refuse: bool = False,
        die_after: int = 0,
        kytctl: str = "kytctl",
    ) -> None:
        self._folder = tempfile.mkdtemp(prefix="kyt-listener-")
        self.socket_path = socket_path or os.path.join(self._folder, "socket")
        self._command = [kytctl, "listen", "--socket", self.socket_path]
        self._command += ["--live", live] if storebag else ["--no-storebag"]
        self._command += ["--refuse"] if refuse else []
        self._command += ["--die-after", str(die_after)] if die_after else []
        self._events: List[Dict[str, Any]] = []
        self._changed = threading.Condition()
        self._ready = False
        self._process: Optional["subprocess.Popen[str]"] = None
        self._reader: Optional[threading.Thread] = None

    def start(self, timeout: float = 10.0) -> None:
        """Listens, again after a stop. What was told before stays."""
        self._ready = False
        process = subprocess.Popen(self._command, stdout=subprocess.PIPE, text=True)
        self._process = process
        self._reader = threading.Thread(target=self._read, args=(process,), daemon=True)
        self._reader.start()
        with self._changed:
            in_time = self._changed.wait_for(lambda: self._ready or process.poll() is not None, timeout)
        if not self._ready:
            self.stop()
            if not in_time:
                raise TimeoutError("kytctl listen did not start in time")
            raise RuntimeError(f"kytctl listen ended with status {process.wait()}")

    def _read(self, process: "subprocess.Popen[str]") -> None:
        assert process.stdout is not None
        for line in process.stdout:
            event = json.loads(line)
            with self._changed:
                if event["event"] == "listening":
                    self._ready = True
                else:
                    self._events.append(event)
                self._changed.notify_all()
        process.wait()
        with self._changed:
            self._changed.notify_all()

    def stop(self) -> None:
        """Ends every connection; the socket is gone. Harmless where it has ended."""
        process, self._process = self._process, None
        if process is None:
            return
        process.terminate()
        process.wait()
        if self._reader is not None:
            self._reader.join()
        if process.stdout is not None:
            process.stdout.close()

    @property
    def is_running(self) -> bool:
        """False once it has died (die_after) or was stopped."""
        return self._process is not None and self._process.poll() is None

    def events(self, kind: Optional[str] = None) -> List[Dict[str, Any]]:
        """What it was told so far: all of it, or the events of one kind."""
        with self._changed:
            return [event for event in self._events if kind is None or event["event"] == kind]

    def wait_for(self, kind: str, count: int = 1, timeout: float = 10.0) -> List[Dict[str, Any]]:
        """The events of that kind, once there are so many of them. Raises TimeoutError otherwise."""
        end = time.monotonic() + timeout
        with self._changed:
            self._changed.wait_for(lambda: len(self._of(kind)) >= count, end - time.monotonic())
            found = self._of(kind)
        if len(found) < count:
            raise TimeoutError(f"{len(found)} of {count} events {kind} came within {timeout:g} s: {self.events()}")
        return found

    def _of(self, kind: str) -> List[Dict[str, Any]]:
        return [event for event in self._events if event["event"] == kind]

    def __enter__(self) -> "Listener":
        try:
            self.start()
        except BaseException:
            shutil.rmtree(self._folder, ignore_errors=True)
            raise
        return self

    def __exit__(
        self,
        kind: Optional[Type[BaseException]],
        value: Optional[BaseException],
        traceback: Optional[TracebackType],
    ) -> None:
        self.stop()
        shutil.rmtree(self._folder, ignore_errors=True)
