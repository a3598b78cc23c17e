"""Collects what a process writes, and waits for lines with a deadline."""

import threading
import time

from .programs import DEADLINE


class LineCollector:
    """Drains a stream in the background, so that the writer never blocks, and keeps its lines."""

    def __init__(self, stream):
        self._stream = stream
        self._lines = []
        self._ended = False
        self._changed = threading.Condition()
        self._thread = threading.Thread(target=self._drain, daemon=True)
        self._thread.start()

    def _drain(self):
        for raw in self._stream:
            with self._changed:
                self._lines.append(raw.decode("utf-8", "replace").rstrip("\n"))
                self._changed.notify_all()
        with self._changed:
            self._ended = True
            self._changed.notify_all()

    def lines(self):
        with self._changed:
            return list(self._lines)

    def text(self):
        return "\n".join(self.lines())

    def wait_for(self, wanted, seconds=DEADLINE, start=0):
        """The first line from number `start` on for which `wanted(line)` holds; None when the
        stream ended without one; AssertionError at the deadline."""
        limit = time.monotonic() + seconds
        seen = start
        with self._changed:
            while True:
                for line in self._lines[seen:]:
                    if wanted(line):
                        return line
                seen = len(self._lines)
                if self._ended:
                    return None
                left = limit - time.monotonic()
                if left <= 0:
                    raise AssertionError("no such line in time; got:\n" + "\n".join(self._lines))
                self._changed.wait(left)

    def finish(self, seconds=DEADLINE):
        """Waits until the writer closed the stream."""
        self._thread.join(seconds)
        assert not self._thread.is_alive(), "the stream was not closed in time"
