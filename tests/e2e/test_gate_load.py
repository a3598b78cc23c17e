"""All kinds of operations from many connections while the configuration file goes bad and good again:
the server comes back to rest each time, and what it acknowledged is there.

ORV_LOAD_SECONDS: how long each of its rounds takes (default 2). ORV_LOAD_CLIENTS: connections (default 12).
"""

import fcntl
import os
import random
import re
import select
import threading
import time

import ldap
import pytest

from orv_e2e import changes, clients, programs, wire
from orv_e2e.changes import PLACE, container

SECONDS = float(os.environ.get("ORV_LOAD_SECONDS", "2"))
CLIENTS = int(os.environ.get("ORV_LOAD_CLIENTS", "12"))
MEBIBYTES = 1 << 20

# 80: the file was there when the operation began, and gone when it was to be written.
SUCCESS, NO_SESSION, BUSY, GONE = 0, 1, 51, 80


class Locked:
    """Keeps all writers out, as an editor that behaves does."""

    def __init__(self, instance):
        self.path = instance.config.path.with_name(instance.config.path.name + ".lock")

    def __enter__(self):
        self.file = open(self.path, "ab")  # pylint: disable=consider-using-with
        fcntl.flock(self.file, fcntl.LOCK_EX)

    def __exit__(self, *_):
        self.file.close()


def replaced(config, text):
    config.replace(text)


def written_in_place(config, text):
    config.path.write_bytes(text)


DAMAGES = [
    lambda config, good: replaced(config, good + b"\nnonsense\n"),
    lambda config, good: replaced(config, good[:len(good) // 2] + b"\ncut"),
    lambda config, good: written_in_place(config, b""),
    lambda config, good: written_in_place(config, good.replace(b"dn: ", b"dn ", 1)),
    lambda config, good: config.path.unlink(),
]


class Editor(threading.Thread):
    """Damages the file and mends it, again and again."""

    def __init__(self, instance, until):
        super().__init__(daemon=True)
        self.instance, self.until = instance, until
        self.damages = 0
        self.failure = None

    def run(self):
        source = random.Random(1)
        config = self.instance.config
        try:
            while not self.until():
                with Locked(self.instance):
                    good = config.read()
                    DAMAGES[self.damages % len(DAMAGES)](config, good)
                time.sleep(source.uniform(0.0, 0.05))
                with Locked(self.instance):
                    # Not in place: of a good file that is being written, a reader may see a half
                    # that is good as well.
                    replaced(config, good)
                    config.path.chmod(0o600)
                self.damages += 1
                time.sleep(source.uniform(0.0, 0.1))
        except Exception as error:  # pylint: disable=broad-except
            self.failure = error


class Client(threading.Thread):
    """Searches, and adds, modifies and deletes entries of its own."""

    def __init__(self, instance, number, until):
        super().__init__(daemon=True)
        self.instance, self.number, self.until = instance, number, until
        self.present = {}  # DN: description
        self.counts = {}   # (kind, code): how often
        self.failure = None

    def run(self):
        source = random.Random(self.number)
        try:
            client = clients.bind(self.instance)
            while not self.until():
                self._operation(client, source)
            client.unbind_s()
        except Exception as error:  # pylint: disable=broad-except
            self.failure = error

    def _operation(self, client, source):
        name = "rest %d %d" % (self.number, source.randrange(10))
        dn = "cn=%s,%s" % (name, PLACE)
        text = "%d by %d" % (sum(self.counts.values()), self.number)
        if source.random() < 0.4:
            return self._note("search", self._search(client, dn))
        if dn not in self.present:
            code = changes.add(client, *container(name, description=[text]))
            kind = "add"
        elif source.random() < 0.6:
            code = changes.modify(client, dn, changes.replaced("description", text))
            kind = "modify"
        else:
            code = changes.delete(client, dn)
            kind = "delete"
        self._note(kind, code)
        if code == SUCCESS and kind == "delete":
            del self.present[dn]
        elif code == SUCCESS:
            self.present[dn] = text
        return None

    def _search(self, client, dn):
        """What the client was told before is what it finds."""
        try:
            found = clients.search(client, PLACE, filter_text="(%s)" % dn.split(",", 1)[0],
                                   attributes=["description"])
        except ldap.LDAPError as error:
            return error.args[0]["result"]
        expected = {dn: {"description": [self.present[dn].encode()]}} if dn in self.present else {}
        assert found == expected, (found, expected)
        return SUCCESS

    def _note(self, kind, code):
        assert code in (SUCCESS, NO_SESSION, BUSY, GONE), (kind, code)
        self.counts[kind, code] = self.counts.get((kind, code), 0) + 1


class Fickle(threading.Thread):
    """Sends operations and abandons them, or leaves in the middle of them."""

    def __init__(self, instance, number, until):
        super().__init__(daemon=True)
        self.instance, self.number, self.until = instance, number, until
        self.failure = None

    def run(self):
        source = random.Random(1000 + self.number)
        try:
            while not self.until():
                self._visit(source)
        except Exception as error:  # pylint: disable=broad-except
            self.failure = error

    def _visit(self, source):
        with wire.Wire(self.instance) as connection:
            code = connection.bind("cn=root", self.instance.password)
            assert code in (SUCCESS, 49), code  # 49 while the key or the file is away
            for number in range(10, 30):
                connection.send(source.choice(FICKLE)(number))
                if source.random() < 0.7:
                    connection.send(wire.abandon_request(number, number))
            if source.random() < 0.5:
                connection.send(wire.unbind_request(99))
                connection.answers_until_closed()


def delete_request(number, dn="cn=nobody," + PLACE):
    return wire.message(number, wire.octets(dn, 0x4A))


def add_request(number, name="abandoned", parent="cn=nowhere," + PLACE):
    attributes = b"".join(
        wire.tlv(0x30, wire.octets(kind) + wire.tlv(0x31, b"".join(map(wire.octets, values))))
        for kind, values in (("objectClass", ["top", "container"]), ("cn", [name])))
    dn = "cn=%s,%s" % (name, parent)
    return wire.message(number, wire.tlv(0x68, wire.octets(dn) + wire.tlv(0x30, attributes)))


def modify_request(number, dn="cn=nobody," + PLACE):
    change = wire.number(2, 0x0A) + wire.tlv(
        0x30, wire.octets("description") + wire.tlv(0x31, wire.octets("x")))
    return wire.message(number, wire.tlv(
        0x66, wire.octets(dn) + wire.tlv(0x30, wire.tlv(0x30, change))))


def accepted_modify_request(number):
    return modify_request(number, PLACE)


OPERATIONS = [wire.search_request, add_request, modify_request, delete_request]
# Modifies that fail for themselves use up the allowance, all the faster the faster the server is.
FICKLE = [wire.search_request, add_request, accepted_modify_request, delete_request]


def descriptors(pid):
    """How many a process has open, of which only root is told: nobody else may look into it."""
    return len(os.listdir("/proc/%d/fd" % pid)) if os.geteuid() == 0 else 0


def resident(pid):
    with open("/proc/%d/status" % pid, encoding="ascii") as status:
        return int(re.search(r"VmRSS:\s+(\d+) kB", status.read()).group(1)) * 1024


def wait_until(condition):
    end = time.monotonic() + programs.DEADLINE
    while not condition():
        assert time.monotonic() < end
        time.sleep(0.01)


def assert_at_rest(server):
    """All kinds of operations are served, by a client that comes and by one that stays."""
    for _ in range(2):
        client = clients.bind(server)
        assert changes.add(client, *container("after")) == 0
        assert changes.modify(client, "cn=after," + PLACE,
                              changes.replaced("description", "x")) == 0
        assert clients.read(client, "cn=after," + PLACE)["description"] == [b"x"]
        assert changes.delete(client, "cn=after," + PLACE) == 0
        client.unbind_s()


def load(server, seconds):
    end = time.monotonic() + seconds

    def over():
        return time.monotonic() > end

    editor = Editor(server, over)
    workers = [Client(server, number, over) for number in range(CLIENTS)]
    fickle = [Fickle(server, number, over) for number in range(2)]
    everybody = [editor, *workers, *fickle]
    for thread in everybody:
        thread.start()
    for thread in everybody:
        thread.join(seconds + 3 * programs.DEADLINE)
        assert not thread.is_alive(), "an operation got no answer"
    assert [thread.failure for thread in everybody] == [None] * len(everybody)
    return editor, workers


def in_file(server):
    found = clients.parse_ldif(server.config.read())
    return {dn: values["description"][0].decode() for dn, values in found.items()
            if dn.startswith("cn=rest ")}


def remove_all(server, present):
    client = clients.bind(server)
    for dn in present:
        assert changes.delete(client, dn) == 0
    client.unbind_s()


def test_server_comes_to_rest_after_a_file_that_went_bad_and_good_under_load(instance):
    # The smallest allowance: modifies that meet a bad file must not use it up.
    instance.config.set(clients.BASE, "orv-slapdMaxFailedChangeSize", "65536")
    server = instance.start()
    assert_at_rest(server)
    pid = server.process.pid
    quiet = descriptors(pid)
    memory = []
    counts = {}
    for _ in range(3):  # the first one fills what the allocator keeps
        editor, workers = load(server, SECONDS)
        acknowledged = {dn: text for worker in workers for dn, text in worker.present.items()}
        assert in_file(server) == acknowledged
        assert_at_rest(server)
        remove_all(server, acknowledged)
        wait_until(lambda: descriptors(pid) <= quiet)
        memory.append(resident(pid))
        assert editor.damages > 0
        for worker in workers:
            for kind, number in worker.counts.items():
                counts[kind] = counts.get(kind, 0) + number
    for kind in ("search", "add", "modify", "delete"):
        assert counts.get((kind, SUCCESS)) and counts.get((kind, NO_SESSION)), counts
    assert programs.sanitized() or memory[-1] - memory[0] < 8 * MEBIBYTES, memory
    print(counts, memory)


@pytest.fixture(name="held")
def held_fixture(instance):
    """A server whose gate a change holds for some three seconds, that change's connection, and one
    for each kind of operation."""
    instance.config.set(clients.BASE, "orv-slapdOperationWait", "1")
    server = instance.start()
    assert_at_rest(server)
    connections = [wire.Wire(server) for _ in range(2 + len(OPERATIONS))]
    for connection in connections:
        assert connection.bind("cn=root", server.password) == 0
    holder, probe, *others = connections
    with Locked(server):
        holder.send(add_request(2, "held", PLACE))
        wait_until_held(probe)
        yield holder, others
    for connection in connections:
        connection.close()


def wait_until_held(probe):
    """Searches until one waits."""
    for number in range(2, 10000):
        probe.send(wire.search_request(number))
        if not select.select([probe.socket], [], [], 0.5)[0]:
            return
        assert probe.search_result(number) == (0, 1)
    raise AssertionError("nobody held the gate")


def test_waiting_operation_of_each_kind_is_told_busy_at_its_deadline(held):
    holder, others = held
    begun = time.monotonic()
    for connection, operation in zip(others, OPERATIONS):
        connection.send(operation(7))
    answers = [connection.answer() for connection in others]
    assert [(answer.message_id, answer.code) for answer in answers] == [(7, BUSY)] * len(others)
    assert time.monotonic() - begun > 0.9
    assert holder.answer().code == BUSY  # the lock, in its case
    for connection in others:
        assert connection.search(8) == (0, 1)


def test_waiting_operation_of_each_kind_can_be_abandoned(held):
    holder, others = held
    for connection, operation in zip(others, OPERATIONS):
        connection.send(operation(7) + wire.abandon_request(8, 7))
        connection.send(wire.search_request(9, base=""))
    assert [connection.search_result(9) for connection in others] == [(0, 1)] * len(others)
    assert holder.answer().code == BUSY
    # No late answer either.
    for connection in others:
        assert connection.search(10) == (0, 1)
