"""What is left in the daemon's memory after a bind, and who may read it."""

import os
import re
import subprocess
import sys

from orv_e2e import programs, wire


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


def without_rights():
    """Takes away what root may do more than others, so that users mean something."""
    return ["setpriv", "--bounding-set=-all", "--inh-caps=-all"] if os.geteuid() == 0 else []


def is_open_to_its_user(pid):
    """Whether another process of the same user may learn what the process's memory is."""
    read = subprocess.run([*without_rights(), "cat", "/proc/%d/maps" % pid], timeout=programs.DEADLINE,
                          stdout=subprocess.PIPE, stderr=subprocess.PIPE, check=False)
    return read.returncode == 0 and read.stdout != b""


def test_memory_is_closed_to_other_processes_of_the_same_user(instance):
    instance.start(wrapper=without_rights())
    assert not is_open_to_its_user(instance.process.pid)
    with subprocess.Popen([*without_rights(), "cat"], stdin=subprocess.PIPE,
                          stdout=subprocess.PIPE) as other:
        other.stdin.write(b"runs")
        other.stdin.flush()
        assert other.stdout.read(4) == b"runs"
        assert is_open_to_its_user(other.pid)  # what is closed is the daemon, not everything
        other.stdin.close()


def test_passwords_sent_to_bind_are_wiped(request, tmp_path):
    if os.geteuid() != 0:
        # In a user namespace of its own this very test is root over the daemon that it starts.
        subprocess.run(["unshare", "--map-root-user", sys.executable, "-m", "pytest", "-q", "-p",
                        "no:cacheprovider", "--basetemp", tmp_path / "inside",
                        "%s::%s" % (__file__, request.node.name)], check=True,
                       timeout=2 * programs.DEADLINE)
        return
    server = request.getfixturevalue("server")
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
