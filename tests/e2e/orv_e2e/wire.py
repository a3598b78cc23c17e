"""LDAP messages by hand, to say what no proper client would say (RFC 4511, BER)."""

import dataclasses
import socket

from .programs import DEADLINE

BIND, BIND_RESPONSE = 0x60, 0x61
UNBIND = 0x42
SEARCH, SEARCH_ENTRY, SEARCH_DONE = 0x63, 0x64, 0x65
ABANDON = 0x50
EXTENDED_RESPONSE = 0x78

NOTICE_OF_DISCONNECTION = b"1.3.6.1.4.1.1466.20036"


def length(count):
    if count < 0x80:
        return bytes([count])
    octets = count.to_bytes((count.bit_length() + 7) // 8, "big")
    return bytes([0x80 | len(octets)]) + octets


def tlv(tag, content):
    return bytes([tag]) + length(len(content)) + content


def number(value, tag=0x02):
    return tlv(tag, value.to_bytes(value.bit_length() // 8 + 1, "big", signed=True))


def octets(value, tag=0x04):
    return tlv(tag, value.encode() if isinstance(value, str) else value)


def message(message_id, operation):
    return tlv(0x30, number(message_id) + operation)


def bind_request(message_id, who, password):
    return message(message_id, tlv(BIND, number(3) + octets(who) + octets(password, 0x80)))


def present(attribute):
    return octets(attribute, 0x87)


def equal(attribute, value):
    return tlv(0xA3, octets(attribute) + octets(value))


def all_of(*filters):
    return tlv(0xA0, b"".join(filters))


def any_of(*filters):
    return tlv(0xA1, b"".join(filters))


def negated(inner):
    return tlv(0xA2, inner)


def search_request(message_id, base="cn=configuration", scope=0, search_filter=None,
                   attributes=("1.1",), time_limit=0):
    names = b"".join(octets(name) for name in attributes)
    return message(message_id, tlv(
        SEARCH, octets(base) + number(scope, 0x0A) + number(0, 0x0A) + number(0)
        + number(time_limit) + b"\x01\x01\x00" + (search_filter or present("objectClass"))
        + tlv(0x30, names)))


def abandon_request(message_id, target):
    return message(message_id, number(target, ABANDON))


def unbind_request(message_id):
    return message(message_id, tlv(UNBIND, b""))


def split(data):
    """The first element of `data` as (tag, content, rest), or None when it is not whole."""
    if len(data) < 2:
        return None
    count, start = data[1], 2
    if count & 0x80:
        start = 2 + (count & 0x7F)
        if len(data) < start:
            return None
        count = int.from_bytes(data[2:start], "big")
    if len(data) < start + count:
        return None
    return data[0], data[start:start + count], data[start + count:]


def elements(data):
    """All elements of `data` as (tag, content)."""
    found = []
    while data:
        tag, content, data = split(data)
        found.append((tag, content))
    return found


@dataclasses.dataclass
class Answer:
    message_id: int
    tag: int
    content: bytes

    @property
    def code(self):
        return int.from_bytes(elements(self.content)[0][1], "big")

    @property
    def is_notice(self):
        """Whether this is the notice of disconnection (RFC 4511, 4.4.1)."""
        return (self.message_id == 0 and self.tag == EXTENDED_RESPONSE
                and (0x8A, NOTICE_OF_DISCONNECTION) in elements(self.content))


def bound(instance, **arguments):
    """A connection bound as the primary administrator."""
    connection = Wire(instance, **arguments)
    assert connection.bind("cn=root", instance.password) == 0
    return connection


class Wire:
    """A plain TCP connection to an instance."""

    def __init__(self, instance, receive_buffer=None):
        self.socket = socket.socket(socket.AF_INET, socket.SOCK_STREAM)
        if receive_buffer:
            self.socket.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, receive_buffer)
        self.socket.settimeout(DEADLINE)
        self.socket.connect((instance.host, instance.port))
        self.socket.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
        self._received = b""

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def close(self):
        self.socket.close()

    def send(self, data):
        self.socket.sendall(data)

    def shut_down_writing(self):
        self.socket.shutdown(socket.SHUT_WR)

    def answer(self):
        """The next whole message; None when the server closed the connection."""
        while True:
            parts = split(self._received)
            if parts:
                _, content, self._received = parts
                (_, message_id), (tag, operation) = elements(content)[:2]
                return Answer(int.from_bytes(message_id, "big"), tag, operation)
            try:
                chunk = self.socket.recv(1 << 20)
            except (ConnectionResetError, BrokenPipeError):
                return None
            if not chunk:
                assert not self._received, "the server closed in the middle of an answer"
                return None
            self._received += chunk

    def answers_until_closed(self):
        found = []
        while (answer := self.answer()) is not None:
            found.append(answer)
        return found

    def bind(self, who, password, message_id=1):
        self.send(bind_request(message_id, who, password))
        answer = self.answer()
        assert answer is not None and answer.tag == BIND_RESPONSE
        return answer.code

    def search(self, message_id, **arguments):
        """Sends a search and reads to its end; gives the result code and the number of entries."""
        self.send(search_request(message_id, **arguments))
        return self.search_result(message_id)

    def search_result(self, message_id):
        entries = 0
        while True:
            answer = self.answer()
            assert answer is not None, "the server closed the connection"
            assert answer.message_id == message_id, answer
            if answer.tag == SEARCH_DONE:
                return answer.code, entries
            assert answer.tag == SEARCH_ENTRY, answer
            entries += 1
