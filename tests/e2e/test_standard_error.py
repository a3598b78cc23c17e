"""A standard error that nobody reads: the server answers, recovers and stops all the same."""

import fcntl
import os
import signal
import subprocess
import threading
import time

import ldap
import pytest

from orv_e2e import clients
from orv_e2e.instance import READY
from orv_e2e.programs import DEADLINE

PIPE_BYTES = 4096  # the least that the system takes
SEARCHES = 2000


class DeafInstance:
    """A daemon whose standard error is a full pipe that nobody reads."""

    def __init__(self, instance, *options):
        self.reader, writer = os.pipe()
        fcntl.fcntl(writer, fcntl.F_SETPIPE_SZ, PIPE_BYTES)
        self.process = subprocess.Popen(
            instance.command(*options), stdin=subprocess.DEVNULL, stdout=subprocess.PIPE,
            stderr=writer, start_new_session=True)
        fill(writer)
        os.close(writer)
        line = self._ready_line()
        match = READY.match(line)
        assert match, line
        self.password = instance.password
        self.url = "ldap://%s:%s" % (match.group("host"), match.group("port"))

    def _ready_line(self):
        """The first line of standard output; an empty one when it does not come in time."""
        alarm = threading.Timer(DEADLINE, self.process.kill)
        alarm.start()
        line = self.process.stdout.readline().decode().rstrip("\n")
        alarm.cancel()
        return line

    def end(self):
        if self.process.poll() is None:
            self.process.kill()
            self.process.wait()
        self.process.stdout.close()
        if self.reader is not None:
            os.close(self.reader)


def fill(writer):
    """Fills a pipe without changing how the daemon sees it for longer than that takes."""
    flags = fcntl.fcntl(writer, fcntl.F_GETFL)
    fcntl.fcntl(writer, fcntl.F_SETFL, flags | os.O_NONBLOCK)
    try:
        while True:
            os.write(writer, b"x" * PIPE_BYTES)
    except BlockingIOError:
        pass
    finally:
        fcntl.fcntl(writer, fcntl.F_SETFL, flags)


@pytest.fixture(name="deaf")
def deaf_fixture(instance):
    made = DeafInstance(instance, "--trace-mask", "0x04030000")
    yield made
    made.end()


def code_of_search(client):
    try:
        client.search_s(clients.BASE, ldap.SCOPE_BASE, "(objectClass=*)", ["1.1"])
        return 0
    except ldap.LDAPError as error:
        return error.args[0].get("result", error.__class__.__name__)


def test_unread_standard_error_stops_neither_answers_nor_the_way_back_nor_the_end(instance, deaf):
    client = clients.bind(deaf)
    whole = instance.config.read()
    instance.config.replace(b"dn: cn=confi")
    codes = set()
    for _ in range(SEARCHES):
        codes.add(code_of_search(client))
        if codes != {1}:
            break
    assert codes == {1}
    instance.config.replace(whole)
    assert code_of_search(client) == 0
    deaf.process.send_signal(signal.SIGTERM)
    assert deaf.process.wait(DEADLINE) == 0


def test_reader_that_comes_late_gets_whole_lines_and_the_count_of_what_was_dropped(instance, deaf):
    client = clients.bind(deaf)
    for _ in range(SEARCHES):
        assert code_of_search(client) == 0
    chunks = []
    reading = threading.Thread(target=lambda: read_all(deaf.reader, chunks))
    reading.start()
    # What comes once there is room again is written.
    limit = time.monotonic() + DEADLINE
    while b"dropped" not in b"".join(chunks) and time.monotonic() < limit:
        code_of_search(client)
    deaf.process.send_signal(signal.SIGTERM)
    assert deaf.process.wait(DEADLINE) == 0
    reading.join(DEADLINE)
    text = b"".join(chunks).lstrip(b"x").decode()
    assert "bytes of standard error were dropped" in text
    assert text.endswith("stopped\n")


def read_all(descriptor, chunks):
    while chunk := os.read(descriptor, 65536):
        chunks.append(chunk)


def test_reader_that_left_harms_nobody(instance):
    made = DeafInstance(instance)
    try:
        os.close(made.reader)
        made.reader = None
        client = clients.bind(made)
        instance.config.replace(b"dn: cn=confi")
        assert {code_of_search(client) for _ in range(50)} == {1}
        made.process.send_signal(signal.SIGTERM)
        assert made.process.wait(DEADLINE) == 0
    finally:
        made.end()


def test_last_words_arrive_although_the_process_ends_at_once(instance):
    instance.config.replace(b"dn: cn=confi")
    for _ in range(20):
        exit_code, stderr = instance.start_refused()
        assert exit_code == 1
        assert str(instance.config.path) in stderr
