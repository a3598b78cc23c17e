"""Many clients search while the file is replaced under them."""

import collections
import threading

from orv_e2e import clients
from orv_e2e.config_file import record
from orv_e2e.programs import DEADLINE

CLIENTS = 32
REPLACEMENTS = 200
SHELF = "cn=shelf,cn=schemas,cn=configuration"


def version(base, number):
    """The file's version `number`: some entries, fewer or more, each of which names it."""
    entries = [record(SHELF, [("objectClass", ["top", "container"]), ("cn", "shelf"),
                              ("description", "%d of %d" % (number, entries_of(number)))])]
    for i in range(entries_of(number)):
        entries.append(record("cn=e%d,%s" % (i, SHELF),
                              [("objectClass", ["top", "container"]), ("cn", "e%d" % i),
                               ("description", "%d of %d" % (number, entries_of(number))),
                               ("description", "filling " * (number % 13))]))
    return base + b"\n" + b"\n".join(entries)


def entries_of(number):
    return 10 + number % 30


def version_of(entries):
    """The number of the version that an answer shows; fails unless it is that version, whole."""
    marks = {values["description"][0] for values in entries.values()}
    assert len(marks) == 1, "one answer mixes versions: %s" % marks
    number, _, count = marks.pop().decode().partition(" of ")
    assert len(entries) == int(count) + 1, "an answer is not whole"
    assert set(entries) == {SHELF} | {"cn=e%d,%s" % (i, SHELF) for i in range(int(count))}
    return int(number)


class Searchers:
    """The clients, and a count of their answers to pace the replacements by."""

    def __init__(self, instance):
        self.connections = [clients.bind(instance) for _ in range(CLIENTS)]
        self.failures = []
        self.seen = collections.Counter()
        self.last = [0] * CLIENTS
        self.answers = 0
        self.stopping = False
        self.changed = threading.Condition()
        self.threads = [threading.Thread(target=self._search, args=(i,)) for i in range(CLIENTS)]
        for thread in self.threads:
            thread.start()

    def _search(self, index):
        try:
            while not self.stopping:
                number = version_of(clients.search(self.connections[index], SHELF))
                assert number >= self.last[index], "an older version came back"
                self.last[index] = number
                with self.changed:
                    self.seen[number] += 1
                    self.answers += 1
                    self.changed.notify_all()
        except Exception as error:  # pylint: disable=broad-except
            with self.changed:
                self.failures.append("client %d: %r" % (index, error))
                self.changed.notify_all()

    def wait_for_answers(self, count):
        with self.changed:
            target = self.answers + count
            assert self.changed.wait_for(lambda: self.failures or self.answers >= target, DEADLINE)
            assert not self.failures, self.failures

    def wait_for_version(self, number):
        with self.changed:
            assert self.changed.wait_for(
                lambda: self.failures or set(self.last) == {number}, DEADLINE), self.last
            assert not self.failures, self.failures

    def stop(self):
        self.stopping = True
        for thread in self.threads:
            thread.join(DEADLINE)
            assert not thread.is_alive()


def test_every_answer_is_one_version_of_the_file_whole(instance):
    base = instance.config.read()
    instance.config.replace(version(base, 0))
    instance.start()
    searchers = Searchers(instance)
    try:
        for number in range(1, REPLACEMENTS + 1):
            instance.config.replace(version(base, number))
            searchers.wait_for_answers(8)
        searchers.wait_for_version(REPLACEMENTS)
    finally:
        searchers.stop()
    assert not searchers.failures
    assert searchers.seen[REPLACEMENTS] > 0
    assert len(searchers.seen) > REPLACEMENTS // 2


def test_file_written_in_place_is_never_answered_in_part(instance):
    """Searches wait for who writes the file in place; if he goes on for too long: 1, never a part."""
    base = instance.config.read()
    texts = [version(base, number) for number in (0, 25)]
    instance.config.replace(texts[0])
    instance.start()
    done = threading.Event()
    writer = threading.Thread(target=_write_in_place, args=(instance, texts, done))
    client = clients.bind(instance)
    writer.start()
    try:
        while not done.is_set():
            entries = _answer(client)
            assert entries is None or version_of(entries) in (0, 25)
    finally:
        writer.join()
    assert version_of(_answer(client)) == 25


def _write_in_place(instance, texts, done):
    for number in range(400):
        instance.config.path.write_bytes(texts[number % 2])
    done.set()


def _answer(client):
    try:
        return clients.search(client, SHELF)
    except (clients.ldap.OPERATIONS_ERROR, clients.ldap.NO_SUCH_OBJECT):
        return None
