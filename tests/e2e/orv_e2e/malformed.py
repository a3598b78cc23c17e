"""Messages with something wrong about them: valid ones, changed at one or a few places in the ways
in which encoders, forgers and networks damage BER (X.690, RFC 4511 5.1).

The same seed gives the same messages.
"""

import random

from . import wire

# Nothing a changed request could hit by its own name: the tests look at this folder for nothing.
TARGET = "cn=malformed,cn=schemas,cn=configuration"
PERSISTENT_SEARCH, ASSERTION = "2.16.840.1.113730.3.4.3", "1.3.6.1.1.12"
PRE_READ, POST_READ, PAGED_RESULTS = "1.3.6.1.1.13.1", "1.3.6.1.1.13.2", "1.2.840.113556.1.4.319"
CONTROLS = (PERSISTENT_SEARCH, "2.16.840.1.113730.3.4.2", "2.16.840.1.113730.3.4.7", ASSERTION,
            PRE_READ, POST_READ, PAGED_RESULTS, "1.2.3.4")
LARGEST = 60000
CANCEL = "1.3.6.1.1.8"
OIDS = ("1.3.6.1.4.1.1466.20037", "1.3.6.1.4.1.4203.1.11.3", CANCEL, "1.2.3")
MECHANISMS = ("EXTERNAL", "PLAIN", "DIGEST-MD5", "SCRAM-SHA-256", "GSSAPI")
FIRST_STEPS = ("", "x", "n,,n=boss,r=aClientsNonce", "c=biws,r=aClientsNonce,p=AAAA", "dn:cn=root",
               'username="boss",nonce="x",response=0123456789abcdef0123456789abcdef')
NUMBERS = (b"", b"\x80", b"\xff", b"\x00" * 8 + b"\x01", b"\x7f\xff\xff\xff", b"\x80\x00\x00\x00",
           b"\x00\x80\x00\x00\x00", b"\xff" * 9, b"\x01" * 64)
TEXTS = (b"", b"\0", b"a\0b", b"\xff\xfe", b"\xc3", b"\xed\xa0\x80", b"*", b"(", b")(cn=*", b"\\",
         b"cn=\\", b",", b"+", b"=", b"cn=#04", b"cn=" + b"x" * 5000, b"%s%n%d", b"\r\n\r\n")


class Node:
    """One element: a tag (all its octets) and either octets or further elements."""

    def __init__(self, tag, content):
        self.tag = bytes([tag]) if isinstance(tag, int) else tag
        self.content = content
        self.length = None  # octets in the place of the right ones
        self.end = b""      # behind the contents
        self.raw = None     # in the place of everything

    def is_set(self):
        return isinstance(self.content, list)

    def body(self):
        if self.is_set():
            return b"".join(child.encoded() for child in self.content)
        return self.content

    def encoded(self):
        if self.raw is not None:
            return self.raw
        body = self.body()
        length = wire.length(len(body)) if self.length is None else self.length
        return self.tag + length + body + self.end

    def all_below(self):
        found = [self]
        if self.is_set():
            for child in self.content:
                found.extend(child.all_below())
        return found


def text(value, tag=0x04):
    return Node(tag, value.encode() if isinstance(value, str) else value)


def number(value, tag=0x02):
    return Node(tag, wire.split(wire.number(value))[1])


def flag(value):
    return Node(0x01, b"\xff" if value else b"\0")


def attribute(name, *values):
    return Node(0x30, [text(name), Node(0x31, [text(value) for value in values])])


# ---- what is changed

def _filter(chance, depth=3):
    kind = chance.randrange(8 if depth else 6)
    if kind == 0:
        return text("objectClass", 0x87)
    if kind == 1:
        return Node(0xA3, [text("cn"), text("x")])
    if kind == 2:
        return Node(0xA4, [text("cn"), Node(0x30, [text("a", 0x80), text("b", 0x81),
                                                   text("c", 0x82)])])
    if kind == 3:
        return Node(chance.choice((0xA5, 0xA6, 0xA8)), [text("cn"), text("x")])
    if kind == 4:
        return Node(0xA9, [text("caseIgnoreMatch", 0x81), text("cn", 0x82), text("x", 0x83),
                           Node(0x84, b"\xff")])
    if kind == 5:
        return Node(0xA3, [text("orv-slapdAdminPW"), text("x")])
    inner = [_filter(chance, depth - 1) for _ in range(chance.randrange(1, 4))]
    return Node(0xA2, inner[:1]) if kind == 6 else Node(chance.choice((0xA0, 0xA1)), inner)


def _bind(chance):
    if chance.randrange(2):
        proof = text("x" * chance.randrange(1, 40), 0x80)
    else:
        proof = Node(0xA3, [text(chance.choice(MECHANISMS))])
        if chance.randrange(4):
            proof.content.append(text(chance.choice(FIRST_STEPS)))
    return Node(0x60, [number(3), text("cn=nobody"), proof])


def _search(chance):
    return Node(0x63, [text(TARGET), number(chance.randrange(3), 0x0A), number(0, 0x0A), number(5),
                       number(5), flag(False), _filter(chance),
                       Node(0x30, [text("cn"), text("1.1")])])


def _add(_):
    return Node(0x68, [text(TARGET), Node(0x30, [
        attribute("objectClass", "top", "container"), attribute("cn", "malformed"),
        attribute("description", "one", "two")])])


def _modify(chance):
    return Node(0x66, [text(TARGET), Node(0x30, [
        Node(0x30, [number(chance.randrange(3), 0x0A), attribute("description", "one", "three")]),
        Node(0x30, [number(1, 0x0A), attribute("seeAlso", "cn=x")])])])


def _rename(_):
    return Node(0x6C, [text(TARGET), text("cn=other"), flag(True), text("cn=configuration", 0x80)])


def _compare(_):
    return Node(0x6E, [text(TARGET), Node(0x30, [text("cn"), text("malformed")])])


# What stands in a value is encoded by itself, but is damaged with the rest.
def _inside(tag, *parts):
    return Node(tag, [Node(0x30, list(parts))])


def _extended(chance):
    name = chance.choice(OIDS)
    request = Node(0x77, [text(name, 0x80)])
    if name == CANCEL:
        request.content.append(_inside(0x81, number(chance.choice((0, 1, 2, 77, 2**31 - 1)))))
    elif chance.randrange(2):
        request.content.append(text("x", 0x81))
    return request


def _control_value(chance, name):
    if name == ASSERTION:
        return Node(0x04, [_filter(chance)])
    if name in (PRE_READ, POST_READ):
        return _inside(0x04, *(text(chance.choice(("cn", "*", "+", "1.1", "orv-slapdAdminPW")))
                               for _ in range(chance.randrange(4))))
    if name == PAGED_RESULTS:
        return _inside(0x04, number(chance.choice((0, 1, 2, 5, 2**31 - 1))),
                       text(chance.choice(("", "x", "x" * 16))))
    return _inside(0x04, number(chance.randrange(16)), flag(True), flag(True))


def _control(chance):
    name = chance.choice(CONTROLS)
    parts = [text(name)]
    if chance.randrange(2):
        parts.append(flag(chance.randrange(2)))
    if chance.randrange(4):
        parts.append(_control_value(chance, chance.choice((name, name, name, *CONTROLS))))
    return Node(0x30, parts)


_OPERATIONS = (_bind, _search, _search, _add, _modify, _rename, _compare, _extended,
               lambda chance: text(TARGET, 0x4A), lambda chance: number(chance.randrange(9), 0x50),
               lambda chance: Node(0x42, b""))


def _message(chance):
    parts = [number(chance.randrange(2, 200)), chance.choice(_OPERATIONS)(chance)]
    if chance.randrange(3) == 0:
        parts.append(Node(0xA0, [_control(chance) for _ in range(chance.randrange(1, 4))]))
    return Node(0x30, parts)


# ---- how

def _lie_about_length(chance, node):
    honest = len(node.body())
    claimed = max(0, honest + chance.choice((-7, -1, 1, 2, 100, 100000)))
    octets = wire.length(claimed)
    if chance.randrange(3) == 0:
        count = chance.choice((1, 2, 4, 8))
        octets = bytes([0x80 | count]) + (claimed % (1 << 8 * count)).to_bytes(count, "big")
    node.length = octets


def _longer_form_of_length(chance, node):
    count = chance.choice((1, 2, 3, 4, 8, 9, 16, 126))
    honest = len(node.body())
    if honest < 1 << 8 * count:
        node.length = bytes([0x80 | count]) + honest.to_bytes(count, "big")


def _extreme_length(chance, node):
    node.length = chance.choice((b"\x84\xff\xff\xff\xff", b"\x84\x7f\xff\xff\xff", b"\x88" + b"\xff" * 8,
                                 b"\x88\x7f" + b"\xff" * 7, b"\xff", b"\x84", b"\x81", b"\x7f",
                                 b"\x89" + b"\xff" * 9))


def _indefinite_length(chance, node):
    node.length = b"\x80"
    node.end = chance.choice((b"\0\0", b"", b"\0"))


def _other_tag(chance, node):
    first = node.tag[0]
    node.tag = chance.choice((
        bytes([chance.randrange(256)]), bytes([first ^ 0x20]), bytes([first ^ 0xC0]),
        bytes([first | 0x1F, chance.randrange(256)]), bytes([first | 0x1F]) + b"\xff" * 6 + b"\x01",
        b"\x1f", b"\0"))


def _other_contents(chance, node):
    if not node.is_set():
        node.content = chance.choice(NUMBERS if node.tag[0] in (0x02, 0x0A, 0x01, 0x50) else TEXTS)
    else:
        node.content = []


def _repeat(chance, node):
    if node.is_set() and node.content:
        again = chance.choice(node.content).encoded()
        times = chance.choice((1, 2, 40, 400))
        node.content.append(Node(b"", b""))
        node.content[-1].raw = again * min(times, LARGEST // (len(again) + 1))
    elif not node.is_set() and len(node.content) < LARGEST // 100:
        node.content = node.content * chance.choice((2, 100))


def _leave_out(chance, node):
    if node.is_set() and node.content:
        del node.content[chance.randrange(len(node.content))]


def _change_places(chance, node):
    if node.is_set():
        chance.shuffle(node.content)


def _nest(chance, node):
    content = node.body()
    levels = chance.choice((1, 3, 40, 400))
    for _ in range(levels if len(content) < LARGEST else 1):
        content = Node(node.tag, content).encoded()
    node.content = content


def _trailing_octets(chance, node):
    node.end = bytes(chance.randrange(256) for _ in range(chance.randrange(1, 9)))


def _strange_element(chance, node):
    strange = Node(chance.choice((0x00, 0x05, 0x1F, 0x30, 0x42, 0x80, 0x8F, 0xA0, 0xBF)),
                   bytes(chance.randrange(256) for _ in range(chance.randrange(6))))
    if node.is_set():
        node.content.insert(chance.randrange(len(node.content) + 1), strange)


ON_ELEMENTS = {
    "length lie": _lie_about_length, "long length": _longer_form_of_length,
    "extreme length": _extreme_length, "indefinite length": _indefinite_length,
    "tag": _other_tag, "contents": _other_contents, "repetition": _repeat, "omission": _leave_out,
    "order": _change_places, "nesting": _nest, "trailing octets": _trailing_octets,
    "strange element": _strange_element,
}


def _cut(chance, data):
    return data[:chance.randrange(len(data))]


def _flip(chance, data):
    changed = bytearray(data)
    for _ in range(chance.randrange(1, 5)):
        changed[chance.randrange(len(changed))] ^= 1 << chance.randrange(8)
    return bytes(changed)


def _append(chance, data):
    return data + bytes(chance.randrange(256) for _ in range(chance.randrange(1, 40)))


ON_BYTES = {"cut": _cut, "flip": _flip, "append": _append}


def malformed(seed, count):
    """`count` messages as (what was done, octets); each of the ways has its turn."""
    chance = random.Random(seed)
    ways = list(ON_ELEMENTS) + list(ON_BYTES)
    for position in range(count):
        way = ways[position % len(ways)]
        tree = _message(chance)
        if way in ON_ELEMENTS:
            for _ in range(chance.choice((1, 1, 1, 2, 4))):
                ON_ELEMENTS[way](chance, chance.choice(tree.all_below()))
            data = tree.encoded()
        else:
            data = ON_BYTES[way](chance, tree.encoded())
        yield way, data[:LARGEST]
