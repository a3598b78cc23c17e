"""Users of the host for tests that run as root: numbers that no account has."""

import os
import pathlib
import subprocess

import pytest

from . import programs
from .instance import Instance

# No user or group of a usual host.
USER = 48231
GROUP = 48232

needs_root = pytest.mark.skipif(os.geteuid() != 0, reason="only root can become another user")


def options(user=USER, group=GROUP):
    return ["--user", str(user), "--group", str(group)]


def instance_of(folder, user=USER, group=GROUP):
    """A fresh instance that belongs to that user, who has to be able to get there."""
    subprocess.run([programs.orvcfg(), "init", "--dir", folder, *options(user, group)], check=True,
                   stdout=subprocess.PIPE, timeout=programs.DEADLINE)
    return Instance(folder)


def give(path, user=USER, group=GROUP):
    os.chown(path, user, group)


def status_of_threads(pid):
    """What the kernel says of each thread: a list of dictionaries."""
    found = []
    for thread in pathlib.Path("/proc/%d/task" % pid).iterdir():
        lines = (thread / "status").read_text().splitlines()
        found.append({name: value.split() for name, _, value in
                      (line.partition(":") for line in lines)})
    return found
