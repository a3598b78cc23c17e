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

from orv_e2e import changes, clients, programs
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
    """Adds, modifies and deletes entries of its own and keeps what was acknowledged."""

    def __init__(self, instance, number, until):
        super().__init__(daemon=True)
        self.instance, self.number, self.until = instance, number, until
        self.present = {}   # DN: the description that was acknowledged, None not there
        self.pending = {}   # DN: what it becomes if the change that was not answered was made
        self.counts = {"add": 0, "modify": 0, "delete": 0}
        self.failure = None

    @property
    def done(self):
        return sum(self.counts.values())

    def run(self):
        random_source = random.Random(self.number)
        try:
            client = clients.bind(self.instance)
            while not self.until():
                self._change(client, random_source)
        except Exception as error:  # pylint: disable=broad-except
            self.failure = error

    def _change(self, client, random_source):
        name = "load %d %d" % (self.number, random_source.randrange(20))
        dn = "cn=%s,%s" % (name, PLACE)
        text = "%d by %d" % (self.done, self.number)
        if self.present.get(dn) is None:
            kind, wanted = "add", text
        else:
            kind, wanted = random_source.choice([("modify", text), ("delete", None)])
        self.pending[dn] = wanted
        code = self._send(client, kind, dn, name, text)
        if code < 0:  # no answer
            raise ldap.SERVER_DOWN({"result": code})
        assert code == 0, (dn, kind, code)
        self.present[dn] = self.pending.pop(dn)
        self.counts[kind] += 1

    @staticmethod
    def _send(client, kind, dn, name, text):
        if kind == "add":
            return changes.add(client, *container(name, description=[text]))
        if kind == "delete":
            return changes.delete(client, dn)
        return changes.modify(client, dn, changes.replaced("description", text))


def in_file(instance):
    """The descriptions of the workers' entries."""
    found = clients.parse_ldif(instance.config.read())
    return {dn: attributes["description"][0].decode() for dn, attributes in found.items()
            if dn.startswith("cn=load ")}


def acknowledged(workers):
    return {dn: text for worker in workers for dn, text in worker.present.items()}


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
    assert in_file(server) == {dn: text for dn, text in acknowledged(workers).items() if text}
    assert all(worker.done > 0 for worker in workers)
    done = {kind: sum(worker.counts[kind] for worker in workers) for kind in workers[0].counts}
    assert all(done.values())
    print("%s, %s readings" % (done, reads.decode().strip()))


@pytest.mark.parametrize("seed", range(STOPS))
def test_killed_server_has_lost_no_acknowledged_change(instance, seed):
    instance.start()
    ended = threading.Event()
    workers = [Worker(instance, number, ended.is_set) for number in range(3)]
    for worker in workers:
        worker.start()
    deadline = time.monotonic() + programs.DEADLINE
    while sum(worker.done for worker in workers) < 5:
        assert time.monotonic() < deadline, [worker.failure for worker in workers]
        time.sleep(0.001)
    time.sleep(random.Random(seed).uniform(0, 0.2))
    instance.process.send_signal(signal.SIGKILL)
    instance.kill()
    ended.set()
    for worker in workers:
        worker.join()
        assert worker.failure is None or isinstance(worker.failure, ldap.SERVER_DOWN)
    there = in_file(instance)
    pending = {dn: text for worker in workers for dn, text in worker.pending.items()}
    known = {**dict.fromkeys(pending), **acknowledged(workers)}
    for dn, text in known.items():
        # What nobody was told of is done wholly or not at all.
        assert there.get(dn) in (text, pending.get(dn, text)), dn
    assert set(there) <= set(known)
    instance.start()
    client = clients.bind(instance)
    found = clients.search(client, PLACE, filter_text="(cn=load *)", attributes=["description"])
    assert {dn: values["description"][0].decode() for dn, values in found.items()} == there
    assert changes.add(client, *container("after")) == 0
    client.unbind_s()
