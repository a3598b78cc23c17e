"""What is left in the daemon's memory after a bind."""

import os
import re

import pytest

from orv_e2e import wire
from orv_e2e.programs import sanitized

pytestmark = [
    pytest.mark.skipif(sanitized(), reason="sanitizers keep freed memory"),
    pytest.mark.skipif(os.geteuid() != 0, reason="only root may read the daemon's memory"),
]


def holds(pid, wanted):
    """Whether writable memory of the process contains the bytes."""
    with open("/proc/%d/maps" % pid, encoding="utf-8") as maps, \
            open("/proc/%d/mem" % pid, "rb", buffering=0) as memory:
        for line in maps:
            found = re.match(r"([0-9a-f]+)-([0-9a-f]+) rw", line)
            if not found:
                continue
            begin, end = (int(edge, 16) for edge in found.groups())
            memory.seek(begin)
            try:
                if wanted in memory.read(end - begin):
                    return True
            except OSError:  # pages that cannot be read
                continue
    return False


def test_passwords_sent_to_bind_are_wiped(server):
    pid = server.process.pid
    short, long = b"Qx7#kRw2!vT", b"Jz5$" + b"pLm9&wQe" * 8
    with wire.Wire(server) as client:
        for password in (short, long):
            client.bind("cn=root", password.decode())
            client.bind("no dn", password.decode())
        client.bind("cn=somebody-to-be-found", "wrong")
        for password in (short, long):
            # Half of it is enough to give it away; the ends may be overwritten by the allocator.
            half = len(password) // 4
            assert not holds(pid, password[half:-half])
        assert holds(pid, server.config.path.name.encode())  # the search itself works
