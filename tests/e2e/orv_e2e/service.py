"""Both sides of a service manager: the socket for notices, and listening sockets handed over."""

import os
import socket
import sys
import time

from . import programs


class Notices:
    """A socket at which a daemon says how it is."""

    def __init__(self, folder):
        self.path = str(folder / "notify")
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.socket.bind(self.path)
        self.socket.settimeout(programs.DEADLINE)

    def next(self):
        """One notice as a dictionary."""
        text = self.socket.recv(4096).decode()
        assert text.endswith("\n")
        return dict(line.split("=", 1) for line in text.splitlines())

    def wait_for(self, key):
        deadline = time.monotonic() + programs.DEADLINE
        while time.monotonic() < deadline:
            notice = self.next()
            if key in notice:
                return notice
        raise AssertionError("no notice with " + key)

    def close(self):
        self.socket.close()


# Puts the inherited descriptors where the protocol wants them, says whom they are for, and becomes
# the program: descriptors, names, and the program's own command line.
_LAUNCHER = """
import os, sys
numbers = [int(number) for number in sys.argv[1].split(",") if number]
kept = [os.dup2(number, 100 + place, inheritable=False) for place, number in enumerate(numbers)]
for place, number in enumerate(kept):
    os.dup2(number, 3 + place, inheritable=True)
os.environ["LISTEN_FDS"] = str(len(numbers))
os.environ["LISTEN_PID"] = str(os.getpid() + int(sys.argv[2]))
if sys.argv[3] != "-":
    os.environ["LISTEN_FDNAMES"] = sys.argv[3]
os.execv(sys.argv[4], sys.argv[4:])
"""


def handing_over(sockets, names="-", pid_offset=0):
    """A wrapper for a command, and the descriptors that it has to be given."""
    numbers = [each.fileno() for each in sockets]
    return [sys.executable, "-c", _LAUNCHER, ",".join(map(str, numbers)), str(pid_offset),
            names], numbers


def listening(family=socket.AF_INET, address=("127.0.0.1", 0)):
    made = socket.socket(family, socket.SOCK_STREAM)
    made.bind(address)
    made.listen(16)
    return made


def descriptors_of(pid):
    """Where the descriptors of a process lead."""
    folder = "/proc/%d/fd" % pid
    return {int(number): os.readlink(os.path.join(folder, number)) for number in os.listdir(folder)}
