"""Many changes at once: the file is whole at every moment, and what was acknowledged is never lost.

ORV_LOAD_SECONDS: how long the clients go on (default 3). ORV_LOAD_STOPS: how often the server is
killed (default 5).
"""

import os
import random
import signal
import subprocess
import sys
import threading
import time

import ldap
import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import PLACE, container

SECONDS = float(os.environ.get("ORV_LOAD_SECONDS", "3"))
CLIENTS = 8
STOPS = int(os.environ.get("ORV_LOAD_STOPS", "5"))

# Reads the file again and again in a process of its own, and ends with the number of versions it saw.
READER = r"""
import os, sys
path, stop = sys.argv[1:]
seen = set()
reads = 0
while not os.path.exists(stop):
    with open(path, "rb") as file:
        text = file.read()
    reads += 1
    if text in seen:
        continue
    seen = {text}
    assert text.startswith(b"version: 1\n"), text[:80]
    assert text.endswith(b"\n") and b"dn: CN=CONFIGDB," in text, text[-200:]
    for block in text.split(b"\n\n"):
        lines = [line for line in block.split(b"\n")
                 if line and not line.startswith((b"#", b"version:"))]
        if lines:
            assert lines[0].startswith((b"dn: ", b"dn:: ")), lines
            assert any(line.startswith(b"objectClass: ") for line in lines), lines
print(reads)
"""


class Worker(threading.Thread):
    """Adds and deletes entries of its own and keeps what was acknowledged."""

    def __init__(self, instance, number, until):
        super().__init__(daemon=True)
        self.instance, self.number, self.until = instance, number, until
        self.present = {}   # DN: True there, False not there, None not known
        self.done = 0
        self.failure = None

    def run(self):
        random_source = random.Random(self.number)
        try:
            client = clients.bind(self.instance)
            while not self.until():
                self._change(client, random_source)
        except Exception as error:  # pylint: disable=broad-except
            self.failure = error

    def _change(self, client, random_source):
        dn, attributes = container("load %d %d" % (self.number, random_source.randrange(20)))
        there = self.present.get(dn, False)
        self.present[dn] = None
        code = changes.delete(client, dn) if there else changes.add(client, dn, attributes)
        if code < 0:  # no answer
            raise ldap.SERVER_DOWN({"result": code})
        assert code == 0, (dn, there, code)
        self.present[dn] = not there
        self.done += 1


def in_file(instance):
    found = clients.parse_ldif(instance.config.read())
    return {dn for dn in found if dn.startswith("cn=load ")}


def test_eight_clients_change_while_another_process_reads(server, tmp_path):
    stop = tmp_path / "stop"
    end = time.monotonic() + SECONDS
    with subprocess.Popen([sys.executable, "-c", READER, str(server.config.path), str(stop)],
                          stdout=subprocess.PIPE) as reader:
        workers = [Worker(server, number, lambda: time.monotonic() > end)
                   for number in range(CLIENTS)]
        for worker in workers:
            worker.start()
        for worker in workers:
            worker.join()
        stop.touch()
        reads, _ = reader.communicate()
        assert reader.returncode == 0 and int(reads) > 0
    assert [worker.failure for worker in workers] == [None] * CLIENTS
    expected = {dn for worker in workers for dn, there in worker.present.items() if there}
    assert in_file(server) == expected
    assert all(worker.done > 0 for worker in workers)
    print("%d changes, %s readings" % (sum(worker.done for worker in workers), reads.decode()))


@pytest.mark.parametrize("seed", range(STOPS))
def test_killed_server_has_lost_no_acknowledged_change(instance, seed):
    instance.start()
    ended = threading.Event()
    workers = [Worker(instance, number, ended.is_set) for number in range(3)]
    for worker in workers:
        worker.start()
    while sum(worker.done for worker in workers) < 5:
        time.sleep(0.001)
    time.sleep(random.Random(seed).uniform(0, 0.2))
    instance.process.send_signal(signal.SIGKILL)
    instance.kill()
    ended.set()
    for worker in workers:
        worker.join()
        assert worker.failure is None or isinstance(worker.failure, ldap.SERVER_DOWN)
    there = in_file(instance)
    known = {dn: is_there for worker in workers for dn, is_there in worker.present.items()
             if is_there is not None}
    assert {dn for dn, is_there in known.items() if is_there} <= there
    assert not {dn for dn, is_there in known.items() if not is_there} & there
    instance.start()
    client = clients.bind(instance)
    assert clients.names(client, "(cn=load *)", PLACE) == there
    assert changes.add(client, *container("after")) == 0
    client.unbind_s()
