"""Thousands of malformed messages, in clear and inside TLS: each gets an answer or an orderly end,
an administrator is served all the while, and neither logs nor memory grow beyond what was asked.

ORV_MALFORMED_MESSAGES is how many there are in clear, ORV_SEED repeats a run.
"""

import os
import random
import re
import socket
import ssl
import time

import pytest

from orv_e2e import clients, malformed, programs, wire
from orv_e2e.programs import DEADLINE

IN_CLEAR = int(os.environ.get("ORV_MALFORMED_MESSAGES", 2000 if programs.sanitized() else 13000))
INSIDE_TLS = IN_CLEAR // 20
AT_ONCE = 40

# What follows the answer to a StartTLS request that came through unharmed is no LDAP.
START_TLS = b"1.3.6.1.4.1.1466.20037"
ALERT_OF_TLS = 0x15

# What one message may cost of the access log: four lines of at most a thousand characters.
MOST_ACCESS_LOG = 4000
MOST_ERROR_LINE = 30000
MOST_MEMORY = 64 << 20


@pytest.fixture(name="seed")
def seed_fixture():
    seed = int(os.environ.get("ORV_SEED", random.SystemRandom().randrange(1 << 32)))
    print("ORV_SEED=%d" % seed)
    return seed


@pytest.fixture(scope="module", name="server")
def server_fixture(module_instance):
    module_instance.config.set(clients.BASE, "orv-slapdMaxUnauthenticatedMessageSize", str(1 << 20))
    return module_instance.start()


class Sender:
    """A connection that sends one malformed message, and no more; its end is what is waited for."""

    def __init__(self, connection, way, data):
        self.connection = connection
        self.way, self.data = way, data
        self.received = b""
        self.connection.settimeout(DEADLINE)

    def send(self, before):
        try:
            self.connection.sendall(before + self.data)
            # Of the connection below TLS: nothing more comes, but answers can still be read.
            socket.socket.shutdown(self.connection, socket.SHUT_WR)
        except (BrokenPipeError, ConnectionResetError, OSError):
            pass  # it was closed already

    def finish(self):
        """Reads to the end; whatever came must be whole messages of LDAP."""
        try:
            while chunk := self.connection.recv(1 << 16):
                self.received += chunk
        except (ConnectionResetError, BrokenPipeError, ssl.SSLError):
            # Closed while octets that nobody will read were on their way, or by an alert of TLS.
            self.received = b""
        self.connection.close()
        rest = self.received
        while rest and not (rest[0] == ALERT_OF_TLS and START_TLS in self.received):
            parts = wire.split(rest)
            assert parts, self.explain("an answer that is not whole")
            tag, content, rest = parts
            assert tag == 0x30 and len(wire.elements(content)) >= 2, self.explain("no answer")

    def explain(self, what):
        return "%s to %s %s: %s" % (what, self.way, self.data.hex(), self.received.hex())


def in_clear(server):
    return socket.create_connection((server.host, server.port), DEADLINE)


def tls_context():
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
    context.check_hostname = False
    context.verify_mode = ssl.CERT_NONE
    return context


def memory(server):
    text = open("/proc/%d/status" % server.process.pid).read()
    return int(re.search(r"VmRSS:\s+(\d+) kB", text).group(1)) * 1024


def batches(messages, size):
    batch = []
    for message in messages:
        batch.append(message)
        if len(batch) == size:
            yield batch
            batch = []
    if batch:
        yield batch


def throw_at(server, messages, connect):
    """Every other sender is bound as the administrator, whose requests go further."""
    before = wire.bind_request(1, "cn=root", server.password)
    with wire.bound(server) as administrator:
        number = 1
        for batch in batches(messages, AT_ONCE):
            senders = [Sender(connect(server), way, data) for way, data in batch]
            for position, sender in enumerate(senders):
                sender.send(before if position % 2 else b"")
            number += 1
            began = time.monotonic()
            assert administrator.search(number) == (0, 1)
            assert time.monotonic() - began < DEADLINE / 2
            for sender in senders:
                try:
                    sender.finish()
                except TimeoutError:
                    raise AssertionError(sender.explain("neither an answer nor an end")) from None


def assert_logs_are_bounded(server, count, before):
    assert server.access_log.stat().st_size - before < MOST_ACCESS_LOG * count
    # Of an administrator's changes that the server refuses one line tells; of strangers none does.
    told = [line for line in server.stderr.lines() if " refused with " not in line]
    # Of each limit that ends connections ten lines a minute tell, and then how many more there were.
    assert len([line for line in told if ": closed " in line]) < 60, told[:60]
    told = [line for line in told if ": closed " not in line]
    assert len(told) < 20, told[:20]
    longest = max(server.stderr.lines(), key=len)
    assert len(longest) < MOST_ERROR_LINE, longest


def test_malformed_messages_in_clear_are_answered_or_ended(server, seed):
    throw_at(server, malformed.malformed(seed, 200), in_clear)
    settled = memory(server)
    logged = server.access_log.stat().st_size
    throw_at(server, malformed.malformed(seed + 1, IN_CLEAR), in_clear)
    assert_logs_are_bounded(server, IN_CLEAR, logged)
    if not programs.sanitized():
        assert memory(server) - settled < MOST_MEMORY


def test_malformed_messages_inside_tls_are_answered_or_ended(server, seed):
    context = tls_context()

    def connect(to):
        plain = socket.create_connection((to.host, to.secure_port), DEADLINE)
        return context.wrap_socket(plain)

    logged = server.access_log.stat().st_size
    throw_at(server, malformed.malformed(seed + 2, INSIDE_TLS), connect)
    assert_logs_are_bounded(server, INSIDE_TLS, logged)
