"""What is measured of the server: memory, descriptors, threads, and how long a search takes."""

import dataclasses
import json
import os
import pathlib
import statistics
import subprocess
import sys
import time

FLOOR = "flushed write p50"
PROBE = pathlib.Path(__file__).resolve().parent / "probe.py"


@dataclasses.dataclass
class Bound:
    """How much larger the last quarter of a run may be than the first."""
    factor: float
    plus: float


# Kilobytes, numbers, milliseconds. The backend keeps a copy of each modification that fails, and
# allocators keep what many connections needed at once; a leak worth the name exceeds this within
# minutes. The latency may grow by this and as much as a flushed write's, which is the disk's doing.
BOUNDS = {
    "RSS": Bound(1.10, 4096), "PSS": Bound(1.10, 4096), "descriptors": Bound(1.10, 8),
    "threads": Bound(1.0, 2), "search p50": Bound(2.0, 2),
}


def sample(pid):
    """What the kernel says of a process now. Only root may look into the server: to others PSS and
    descriptors are 0."""
    folder = pathlib.Path("/proc/%d" % pid)
    status = dict(line.split(":", 1) for line in (folder / "status").read_text().splitlines())
    shown = {"RSS": int(status["VmRSS"].split()[0]), "PSS": 0, "descriptors": 0,
             "threads": int(status["Threads"])}
    if os.geteuid() == 0:
        smaps = dict(line.split(":", 1)
                     for line in (folder / "smaps_rollup").read_text().splitlines()[1:])
        shown.update(PSS=int(smaps["Pss"].split()[0]), descriptors=len(os.listdir(folder / "fd")))
    return shown


def processor_seconds(pid):
    """What a process has used of the processors, in its own code and in the system."""
    text = pathlib.Path("/proc/%d/stat" % pid).read_text()
    own, system = text.rsplit(")", 1)[1].split()[11:13]
    ticks = os.sysconf("SC_CLK_TCK")
    return int(own) / ticks, int(system) / ticks


class Samples:
    """Values with their times."""

    def __init__(self):
        self.times = []
        self.values = {}

    def add(self, values):
        self.times.append(time.monotonic())
        for name, value in values.items():
            self.values.setdefault(name, []).append(value)

    def quarters(self, begin, end):
        """The mean of the first and of the last quarter of the time from `begin` to `end`."""
        length = (end - begin) / 4
        return {name: (_mean(self._within(values, begin, begin + length)),
                       _mean(self._within(values, end - length, end)))
                for name, values in self.values.items()}

    def _within(self, values, begin, end):
        return [value for when, value in zip(self.times, values) if begin <= when <= end]


def _mean(values):
    return statistics.fmean(values) if values else float("nan")


class Probe:
    """An administrator in a process of its own, so that it does not wait for the load's process:
    a search again and again on one connection, and from time to time on a new one."""

    def __init__(self, instance, pause):
        self.process = subprocess.Popen(
            [sys.executable, str(PROBE), instance.host, str(instance.port),
             str(instance.directory / "admin.pw"), str(pause)], stdin=subprocess.PIPE,
            stdout=subprocess.PIPE, text=True)
        self.searches = []   # (time, milliseconds, code)
        self.newcomers = []  # the same of connecting, binding and searching
        self.floors = []     # and of a page that is written and flushed

    def stop(self):
        text, _ = self.process.communicate("stop\n", 60)
        if self.process.returncode != 0:
            raise RuntimeError("the probe failed")
        found = json.loads(text)
        self.searches, self.newcomers = found["searches"], found["newcomers"]
        self.floors = found["floors"]

    def quarters(self, begin, end):
        """(first, last) of medians, and of the 99th percentile of the searches."""
        length = (end - begin) / 4

        def parts(measured, which):
            return tuple(percentile([took for when, took, _ in measured if low <= when <= high],
                                    which)
                         for low, high in ((begin, begin + length), (end - length, end)))

        return {"search p50": parts(self.searches, 50), "search p99": parts(self.searches, 99),
                FLOOR: parts(self.floors, 50)}


def percentile(values, which):
    if not values:
        return float("nan")
    ordered = sorted(values)
    return ordered[min(len(ordered) - 1, len(ordered) * which // 100)]


def growth_failures(quarters):
    """What grew beyond its bound."""
    found = []
    slower = max(1.0, quarters[FLOOR][1] / quarters[FLOOR][0])
    for name, bound in BOUNDS.items():
        first, last = quarters[name]
        allowed = first * (slower if name == "search p50" else 1) * bound.factor + bound.plus
        if not last <= allowed:
            found.append("%s grew from %.1f to %.1f" % (name, first, last))
    return found
