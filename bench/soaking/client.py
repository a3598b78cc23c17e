"""LDAP clients on asyncio, made of the messages of tests/e2e/orv_e2e/wire.py."""

import asyncio
import socket
import ssl
import struct

from orv_e2e import wire

ADD, MODIFY, DELETE = 0x68, 0x66, 0x4A
EXTENDED, EXTENDED_RESPONSE = 0x77, 0x78
SEARCH_ENTRY, SEARCH_REFERENCE = 0x64, 0x73
START_TLS = "1.3.6.1.4.1.1466.20037"
PERSISTENT = "2.16.840.1.113730.3.4.3"
TRANSPORTS = ("clear", "start-tls", "ldaps")

# Seconds after which an answer that a good client waits for is a failure.
DEADLINE = 60.0


class Lost(Exception):
    """The server ended the connection; the notice's code and text where it said why."""

    def __init__(self, code=None, text=""):
        super().__init__("connection lost: %s %s" % (code, text))
        self.code = code


def attribute(name, values):
    return wire.tlv(0x30, wire.octets(name) + wire.tlv(0x31, b"".join(
        wire.octets(value) for value in values)))


def add_operation(dn, attributes):
    listed = b"".join(attribute(name, values) for name, values in attributes.items())
    return wire.tlv(ADD, wire.octets(dn) + wire.tlv(0x30, listed))


def replace_operation(dn, name, values):
    change = wire.tlv(0x30, wire.number(2, 0x0A) + attribute(name, values))
    return wire.tlv(MODIFY, wire.octets(dn) + wire.tlv(0x30, change))


def delete_operation(dn):
    return wire.octets(dn, DELETE)


def persistent_control():
    """All changes from now on, without notes on what kind they are."""
    value = wire.tlv(0x30, wire.number(7) + b"\x01\x01\xff" + b"\x01\x01\x00")
    control = wire.tlv(0x30, wire.octets(PERSISTENT) + b"\x01\x01\xff" + wire.octets(value))
    return wire.tlv(0xA0, control)


def tls_context(instance):
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
    context.load_verify_locations(instance.certificate)
    return context


def decoded(entry):
    """A search entry's DN and attributes."""
    (_, dn), (_, listed) = wire.elements(entry)
    attributes = {}
    for _, pair in wire.elements(listed):
        (_, name), (_, values) = wire.elements(pair)
        attributes[name.decode()] = [value for _, value in wire.elements(values)]
    return dn.decode(), attributes


class Client:
    """One connection. `call` sends a request and reads up to its result; what comes for others that
    are outstanding is counted in `heard`."""

    def __init__(self, reader, writer):
        self.reader, self.writer = reader, writer
        self.received = b""
        self.last_id = 0
        self.heard = 0

    @classmethod
    async def open(cls, instance, transport="clear", context=None, source=None):
        port = instance.secure_port if transport == "ldaps" else instance.port
        tls = {"ssl": context, "server_hostname": "localhost"} if transport == "ldaps" else {}
        reader, writer = await asyncio.wait_for(asyncio.open_connection(
            instance.host, port, local_addr=(source, 0) if source else None, **tls), DEADLINE)
        client = cls(reader, writer)
        if transport == "start-tls":
            await client.start_tls(context)
        return client

    async def start_tls(self, context):
        code, _ = await self.call(wire.tlv(EXTENDED, wire.octets(START_TLS, 0x80)))
        if code:
            raise Lost(code, "StartTLS")
        await self.writer.start_tls(context, server_hostname="localhost")

    def send(self, operation, controls=b""):
        """Sends a request and gives its message id."""
        self.last_id += 1
        self.writer.write(wire.tlv(0x30, wire.number(self.last_id) + operation + controls))
        return self.last_id

    async def answer(self):
        while not (parts := wire.split(self.received)):
            chunk = await self.reader.read(1 << 16)
            if not chunk:
                raise Lost()
            self.received += chunk
        _, content, self.received = parts
        (_, message_id), (tag, operation) = wire.elements(content)[:2]
        return wire.Answer(int.from_bytes(message_id, "big"), tag, operation)

    async def result(self, message_id):
        """The code of a request, and the entries that came before."""
        entries = []
        while True:
            answer = await asyncio.wait_for(self.answer(), DEADLINE)
            if answer.is_notice:
                raise Lost(answer.code, wire.elements(answer.content)[2][1].decode())
            if answer.message_id != message_id:
                self.heard += 1
            elif answer.tag == SEARCH_ENTRY:
                entries.append(decoded(answer.content))
            elif answer.tag != SEARCH_REFERENCE:
                return answer.code, entries

    async def call(self, operation):
        return await self.result(self.send(operation))

    async def bind(self, who, password):
        code, _ = await self.call(_operation(wire.bind_request(1, who, password)))
        return code

    async def search(self, base, scope=0, search_filter=None, attributes=()):
        return await self.call(search_operation(base, scope, search_filter, attributes))

    def close(self):
        """Leaves in order; what the server still sends is nobody's."""
        try:
            self.writer.write(wire.unbind_request(self.last_id + 1))
        finally:
            self.writer.close()

    def reset(self):
        """Leaves without a word, and lets the server know by a reset."""
        raw = self.writer.get_extra_info("socket")
        if raw is not None and raw.fileno() >= 0:
            raw.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 0))
        self.writer.transport.abort()


def search_operation(base, scope=0, search_filter=None, attributes=()):
    return _operation(wire.search_request(1, base, scope, search_filter, attributes))


def _operation(message):
    """What stands behind the message id."""
    _, content, _ = wire.split(message)
    return content[3:]
