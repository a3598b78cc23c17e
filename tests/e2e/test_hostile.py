"""One test for each class of defect that LDAP servers have had, as far as it is seen from outside.
docs/security.md lists the classes and names all their tests, also those that stand elsewhere.

Messages in which anything may be wrong: test_malformed.py.
"""

import os

import ldap
import pytest

from orv_e2e import clients, programs, wire
from orv_e2e.malformed import Node, attribute, flag, number, text
from test_audit_log import Records, log_of
from test_persistent_search import member_dn
from test_secrets_in_logs import MARKER, traced, written  # noqa: F401

SCHEMAS = "cn=schemas,cn=configuration"
PERSISTENT_SEARCH = "2.16.840.1.113730.3.4.3"
MANAGE_DSA_IT = "2.16.840.1.113730.3.4.2"
ENTRY_CHANGE = "2.16.840.1.113730.3.4.7"
ASSERTION = "1.3.6.1.1.12"
PRE_READ = "1.3.6.1.1.13.1"
POST_READ = "1.3.6.1.1.13.2"
PAGED_RESULTS = "1.2.840.113556.1.4.319"
WHO_AM_I = "1.3.6.1.4.1.4203.1.11.3"
CANCEL = "1.3.6.1.1.8"

# What no request may take, in seconds of the server's time; sanitizers take several times as long.
SLOW = 10 if programs.sanitized() else 1


@pytest.fixture(scope="module", name="server")
def server_fixture(module_instance):
    for limit in ("orv-slapdMaxMessageSize", "orv-slapdMaxUnauthenticatedMessageSize"):
        module_instance.config.set(clients.BASE, limit, str(16 << 20))
    return module_instance.start()


@pytest.fixture(name="good")
def good_fixture(server):
    """Somebody else, who has to be served whatever happens."""
    with wire.bound(server) as connection:
        yield connection
        assert connection.search(9999) == (0, 1), "somebody else is not served any more"


@pytest.fixture(name="root")
def root_fixture(server):
    with wire.bound(server) as connection:
        yield connection


def request(number_of_message, operation, controls=None):
    parts = [number(number_of_message), operation]
    if controls is not None:
        parts.append(Node(0xA0, controls))
    return Node(0x30, parts).encoded()


def search(base=clients.BASE, scope=0, search_filter=None, names=("1.1",), size=0, seconds=0):
    return Node(0x63, [text(base), number(scope, 0x0A), number(0, 0x0A), number(size),
                       number(seconds), flag(False), search_filter or text("objectClass", 0x87),
                       Node(0x30, [text(name) for name in names])])


def addition(dn, *attributes):
    return Node(0x68, [text(dn), Node(0x30, list(attributes))])


def modification(dn, *changes):
    return Node(0x66, [text(dn), Node(0x30, [
        Node(0x30, [number(how, 0x0A), attribute(name, *values)])
        for how, name, values in changes])])


def bind(name="cn=nobody", password="x", version=3):
    return Node(0x60, [number(version), text(name), text(password, 0x80)])


def sasl_bind(mechanism, credentials=None):
    parts = [text(mechanism)]
    if credentials is not None:
        parts.append(text(credentials))
    return Node(0x60, [number(3), text(""), Node(0xA3, parts)])


def every_operation(base="cn=absent," + SCHEMAS):
    """One request of each kind; none of them finds what it is about."""
    return {
        "bind": bind(),
        "SASL bind": sasl_bind("PLAIN", "\0a\0b"),
        "search": search(base),
        "add": addition("cn=x," + base, attribute("objectClass", "top", "container"),
                        attribute("cn", "x")),
        "modify": modification(base, (0, "description", ["x"])),
        "delete": text(base, 0x4A),
        "rename": Node(0x6C, [text(base), text("cn=y"), flag(True)]),
        "compare": Node(0x6E, [text(base), Node(0x30, [text("cn"), text("x")])]),
        "extended": Node(0x77, [text("1.2.3", 0x80), text("x", 0x81)]),
        "abandon": number(77, 0x50),
        "unbind": Node(0x42, b""),
    }


def answer_or_end(connection):
    """The next answer that is no entry; None when the connection ended, with or without a notice."""
    while True:
        answer = connection.answer()
        if answer is None or answer.is_notice:
            return None
        if answer.tag != wire.SEARCH_ENTRY:
            return answer


class Stopwatch:
    """How much of a processor the server used since it was started, in seconds."""

    def __init__(self, server):
        self.path = "/proc/%d/stat" % server.process.pid
        self.begun = self._used()

    def _used(self):
        fields = open(self.path).read().rsplit(")", 1)[1].split()
        return (int(fields[11]) + int(fields[12])) / os.sysconf("SC_CLK_TCK")

    def seconds(self):
        return self._used() - self.begun


# ---- default rules that are too open

ANYBODYS = {"", "cn=schema"}


@pytest.mark.parametrize("names", [(), ("*",), ("+",), ("*", "+"), ("orv-slapdAdminDN",), ("1.1",)])
def test_fresh_instance_shows_strangers_nothing_but_the_root_dse_and_the_schema(server, names):
    with wire.Wire(server) as stranger:
        position = 1
        for base in ("", "cn=configuration", "cn=admingroup,cn=configuration", "cn=schema", "cn=monitor",
                     "cn=localhost", "cn=config", "o=x"):
            for scope in (0, 1, 2):
                position += 1
                stranger.send(request(position, search(base, scope, names=names)))
                while (answer := stranger.answer()).tag == wire.SEARCH_ENTRY:
                    dn = wire.elements(answer.content)[0][1].decode()
                    assert dn in ANYBODYS and dn == base
                    assert b"slapdAdmin" not in answer.content or dn == "cn=schema"
                if base.endswith("configuration"):
                    assert answer.code == 50


def test_fresh_instance_changes_nothing_for_strangers(server):
    before = server.config.read()
    for name, operation in every_operation(clients.BASE).items():
        with wire.Wire(server) as stranger:
            stranger.send(request(1, operation))
            if name not in ("abandon", "unbind"):
                assert answer_or_end(stranger).code not in (0, 14), name
    assert server.config.read() == before


# ---- a single message before bind

@pytest.mark.parametrize("kind", every_operation())
def test_first_message_of_a_connection_may_be_anything(server, good, kind):
    for position in (1, 2**31 - 1):
        with wire.Wire(server) as stranger:
            stranger.send(request(position, every_operation()[kind]))
            stranger.shut_down_writing()
            answers = stranger.answers_until_closed()
            expected = 0 if kind in ("abandon", "unbind") else 1
            assert [answer.message_id for answer in answers] == [position] * expected


# ---- filters, deep and wide

def nested(depth):
    inner = wire.present("objectClass")
    heads, length = [], len(inner)
    for _ in range(depth - 1):
        heads.append(b"\xa2" + wire.length(length))
        length += len(heads[-1])
    return b"".join(reversed(heads)) + inner


@pytest.mark.parametrize("depth", [1, 10, 32, 33, 100, 1000, 10000, 100000])
def test_depth_of_a_filter_is_served_or_refused(server, root, depth):
    used = Stopwatch(server)
    root.send(wire.search_request(2, search_filter=nested(depth)))
    code = answer_or_end(root).code
    assert code == (0 if depth <= 32 else 11)
    assert root.search(3) == (0, 1)
    assert used.seconds() < SLOW


@pytest.mark.parametrize("width", [1, 100, 4000, 4097, 100000, 500000])
@pytest.mark.parametrize("kind", [wire.all_of, wire.any_of], ids=["and", "or"])
def test_width_of_a_filter_is_served_or_refused(server, root, width, kind):
    used = Stopwatch(server)
    one = wire.present("cn") if kind is wire.all_of else wire.equal("cn", "x")
    root.send(wire.search_request(2, scope=2, search_filter=kind(*[one] * width)))
    assert answer_or_end(root).code == (0 if width <= 4000 else 11)
    assert root.search(3) == (0, 1)
    assert used.seconds() < SLOW


# ---- repeated elements

MANY = 500000


def repeated(what):
    selected = text("cn").encoded() * MANY
    one_value = text("x").encoded() * MANY
    one_attribute = attribute("description", "x").encoded()
    one_change = Node(0x30, [number(0, 0x0A), attribute("description", "x")]).encoded()
    one_control = Node(0x30, [text("1.2.3")]).encoded()
    dn = text("cn=absent," + SCHEMAS)
    if what == "controls":
        return Node(0x30, [number(2), search(), Node(0xA0, one_control * MANY)]).encoded()
    operation = {
        "selected attributes": lambda: Node(0x63, search().content[:-1] + [Node(0x30, selected)]),
        "values of an add": lambda: Node(0x68, [dn, Node(0x30, [Node(0x30, [
            text("description"), Node(0x31, one_value)])])]),
        "values of a modify": lambda: Node(0x66, [dn, Node(0x30, [Node(0x30, [
            number(0, 0x0A), Node(0x30, [text("description"), Node(0x31, one_value)])])])]),
        "attributes": lambda: Node(0x68, [dn, Node(0x30, one_attribute * MANY)]),
        "modifications": lambda: Node(0x66, [dn, Node(0x30, one_change * MANY)]),
        "pieces of a substring": lambda: search(search_filter=Node(0xA4, [
            text("cn"), Node(0x30, text("a", 0x81).encoded() * MANY)])),
        "extensions": lambda: Node(0x63, search().content + [Node(0x8F, b"")] * MANY),
        "parts of a name": lambda: search("cn=x" + "+cn=x" * MANY),
        "levels of a name": lambda: search(",".join(["cn=x"] * MANY)),
    }[what]()
    return request(2, operation)


@pytest.mark.parametrize("what,codes", [
    ("controls", {11}), ("selected attributes", {11}), ("values of an add", {11}),
    ("values of a modify", {11}), ("attributes", {11}), ("modifications", {11}),
    ("pieces of a substring", {11}), ("extensions", {0}), ("parts of a name", {34}),
    ("levels of a name", {34})])
def test_half_a_million_of_anything_is_refused_in_no_time(server, root, good, what, codes):
    data = repeated(what)
    used = Stopwatch(server)
    root.send(data)
    answer = answer_or_end(root)
    assert answer is not None and answer.code in codes
    assert used.seconds() < SLOW
    assert root.search(3) == (0, 1)


# ---- one request that takes long

def test_requests_of_the_largest_size_take_no_time(server):
    root = clients.bind(server)
    dn = "cn=large,%s" % SCHEMAS
    values = [b"value %d" % number_of_value for number_of_value in range(9990)]
    root.add_s(dn, [("objectClass", [b"top", b"container"]), ("cn", [b"large"]),
                    ("description", values)])
    long_part = "a" * 240000
    requests = {
        "values added": (root.modify_s, dn, [(0, "description", [b"n" + value for value in values])]),
        "values that are there": (root.modify_s, dn, [(0, "description", [b"new", *values[:-1]])]),
        "values deleted": (root.modify_s, dn, [(1, "description", values[::-1])]),
        "values that are not there": (root.modify_s, dn, [(1, "description", [
            b"x" + value for value in values])]),
        "long values": (root.modify_s, dn, [(2, "description", [b"a" * 480000, b"a" * 480001])]),
        "part of them": (root.search_s, SCHEMAS, 2, "(description=*%sb*)" % long_part, ["1.1"]),
        "parts of them": (root.search_s, SCHEMAS, 2, "(description=*%sb)" % ("a*" * 2000), ["1.1"]),
        "names": (root.search_s, SCHEMAS, 2, "(objectClass=*)", ["x%d" % i for i in range(1000)]),
    }
    for name, (call, *arguments) in requests.items():
        used = Stopwatch(server)
        try:
            call(*arguments)
        except (ldap.TYPE_OR_VALUE_EXISTS, ldap.NO_SUCH_ATTRIBUTE):
            pass
        except ldap.ADMINLIMIT_EXCEEDED:  # more values than an entry may have
            assert name == "values added"
        assert used.seconds() < SLOW, name
    root.delete_s(dn)
    root.unbind_s()


def test_controls_of_the_largest_size_take_no_time(server):
    dn = "cn=large," + SCHEMAS
    client = clients.bind(server)
    client.add_s(dn, [("objectClass", [b"top", b"container"]), ("cn", [b"large"]),
                      ("description", [b"a" * 480000, b"a" * 480001])])
    one = Node(0xA4, [text("description"), Node(0x30, [text("a" * 240000 + "b", 0x81)])])
    pieces = Node(0xA4, [text("description"), Node(0x30, [text("a", 0x81)] * 2000 + [text("b", 0x82)])])
    # Each looks at all of the values, for which the thread sanitizer takes a hundred times as long.
    items = 400 if programs.sanitized() else 4000
    wide = Node(0xA1, [Node(0xA3, [text("description"), text("x%d" % i)]) for i in range(items)])
    names = Node(0x30, [text("x%d" % i) for i in range(1000)]).encoded()
    change = modification(dn, (0, "description", ["new"]))
    conditions = {"part": one, "parts": pieces, "items": wide}
    with wire.bound(server) as root:
        for position, (name, condition) in enumerate(conditions.items(), start=2):
            used = Stopwatch(server)
            root.send(request(position, change, [control(ASSERTION, True, condition.encoded())]))
            assert root.answer().code == 122, name
            assert used.seconds() < SLOW, name
        used = Stopwatch(server)
        reads = [control(oid, True, names) for oid in (PRE_READ, POST_READ)]
        root.send(request(20, change, reads))
        assert root.answer().code in (0, 11)
        for position in range(30):  # each page asks for all, and the search is forgotten with the next
            root.send(request(30 + position, search(scope=2, names=("*",)), [
                control(PAGED_RESULTS, True, page(b"\1"))]))
            assert answer_or_end(root).code == 0
        assert used.seconds() < SLOW
        assert root.search(9999) == (0, 1)
    client.delete_s(dn)
    client.unbind_s()


# ---- zero-length values everywhere

def emptied(tree, position):
    """A copy of the tree in which one element is empty."""
    copied = Node(tree.tag, [emptied(child, -1) for child in tree.content]
                  if tree.is_set() else tree.content)
    if position >= 0:
        copied.all_below()[position].content = b""
    return copied


def whole_operations():
    operations = every_operation()
    operations["search with a large filter"] = search(search_filter=Node(0xA0, [
        Node(0xA3, [text("cn"), text("x")]), Node(0xA4, [text("cn"), Node(0x30, [
            text("a", 0x80), text("b", 0x81), text("c", 0x82)])]),
        Node(0xA5, [text("cn"), text("x")]), Node(0xA8, [text("cn"), text("x")]),
        Node(0xA9, [text("caseIgnoreMatch", 0x81), text("cn", 0x82), text("x", 0x83), Node(0x84, b"\xff")]),
        Node(0xA2, [text("cn", 0x87)])]))
    return operations


@pytest.mark.parametrize("kind", whole_operations())
def test_element_without_contents_is_refused_or_means_nothing(server, good, kind):
    controls = Node(0xA0, [Node(0x30, [text(PERSISTENT_SEARCH), flag(False), text("x")])])
    whole = Node(0x30, [number(2), whole_operations()[kind], controls])
    for position in range(len(whole.all_below())):
        for who in ("cn=root", None):
            with wire.Wire(server) as connection:
                if who:
                    assert connection.bind(who, server.password) == 0
                connection.send(emptied(whole, position).encoded())
                connection.shut_down_writing()
                answers = connection.answers_until_closed()
                assert len(answers) <= 1
                for answer in answers:
                    # An empty name without a password is the anonymous bind; an empty base is the
                    # root DSE's.
                    assert answer.is_notice or answer.code != 0 or kind in (
                        "bind", "search", "search with a large filter")


def test_values_without_octets_are_kept_or_refused(server):
    root = clients.bind(server)
    dn = "cn=empty value," + SCHEMAS
    codes = set()
    for values in ([b""], [b"", b"x"], [b"x", b""], [b"", b""]):
        try:
            root.add_s(dn, [("objectClass", [b"top", b"container"]), ("cn", [b"empty value"]),
                            ("description", values)])
            found = clients.read(root, dn)["description"]
            assert sorted(found) == sorted(values)
            root.delete_s(dn)
            codes.add(0)
        except ldap.LDAPError as error:
            codes.add(error.args[0]["result"])
    root.unbind_s()
    assert codes <= {0, 20, 21}


# ---- every control in every form

GOOD_WISHES = Node(0x30, [number(15), flag(True), flag(True)]).encoded()
EVERYWHERE = set(every_operation())
CHANGES = {"add", "modify", "delete", "rename"}
# What each is used for, and a good value, if it has one.
CONTROLS = {
    PERSISTENT_SEARCH: ({"search"}, GOOD_WISHES),
    MANAGE_DSA_IT: (EVERYWHERE, None),
    ENTRY_CHANGE: (set(), Node(0x30, [number(1, 0x0A)]).encoded()),
    ASSERTION: (CHANGES | {"search", "compare"}, wire.present("objectClass")),
    PRE_READ: (CHANGES - {"add"}, Node(0x30, [text("cn"), text("*")]).encoded()),
    POST_READ: (CHANGES - {"delete"}, Node(0x30, [text("cn"), text("*")]).encoded()),
    PAGED_RESULTS: ({"search"}, Node(0x30, [number(5), text("")]).encoded()),
    "1.2.3.4": (set(), b"x"),
}


def wishes(size, last=flag(True)):
    """Three elements of which the first is the number that is lied about."""
    return Node(0x30, [Node(0x02, size), flag(True), last]).encoded()


def page(size, cookie=text("")):
    return Node(0x30, [Node(0x02, size), cookie]).encoded()


# No form of them is a good value of any control.
BAD_FORMS = {
    "absent": lambda good: None, "empty": lambda good: b"", "truncated": lambda good: good[:-1],
    "cut to its head": lambda good: good[:2], "trailing": lambda good: good + b"\0",
    "repeated": lambda good: good * 2, "inside a text": lambda good: text(good).encoded(),
    "a number": lambda good: number(5).encoded(), "a set": lambda good: b"\x31" + good[1:],
    "deep": lambda good: b"\x30\x80" * 300, "huge": lambda good: b"x" * 100000,
    "of extreme length": lambda good: good[:1] + b"\x84\xff\xff\xff\xff" + good[2:],
    "a negative wish": lambda good: wishes(b"\xff"), "no wish": lambda good: wishes(b"\0"),
    "an over-long wish": lambda good: wishes(b"\0" * 9 + b"\x01"),
    "page size -1": lambda good: page(b"\xff"), "page size without octets": lambda good: page(b""),
    "page size -2^31": lambda good: page(b"\x80\0\0\0"),
    "page size 2^31": lambda good: page(b"\0\x80\0\0\0"),
    "page without a cookie": lambda good: Node(0x30, [number(5)]).encoded(),
    "cookie that is a number": lambda good: page(b"\5", number(7)),
    "names that are sets": lambda good: Node(0x30, [Node(0x30, [])]).encoded(),
    "unfinished filter": lambda good: Node(0xA3, [text("cn")]).encoded(),
    "filter of a choice that there is not": lambda good: Node(0xBF, [text("cn")]).encoded(),
}
WHO_AM_I_REQUEST = Node(0x77, [text(WHO_AM_I, 0x80)])
CANCEL_REQUEST = Node(0x77, [text(CANCEL, 0x80), text(Node(0x30, [number(4711)]).encoded(), 0x81)])


def control(oid, critical, value):
    parts = [text(oid)]
    if critical is not None:
        parts.append(flag(critical))
    if value is not None:
        parts.append(text(value))
    return Node(0x30, parts)


def operations_with_answers():
    return {kind: operation for kind, operation in every_operation().items()
            if kind not in ("abandon", "unbind")} | {
                "who am I": WHO_AM_I_REQUEST, "cancel": CANCEL_REQUEST}


def codes_with(server, controls):
    """What each operation ends with; after binds somebody is bound again."""
    found = {}
    with wire.bound(server) as connection:
        for position, (kind, operation) in enumerate(operations_with_answers().items(), start=1):
            connection.send(request(10 * position, operation, controls))
            answer = connection.answer()
            assert answer is not None and answer.message_id == 10 * position, kind
            found[kind] = answer.code
            if "bind" in kind:
                assert connection.search(10 * position + 1)[0] == 50, "a failed bind binds nobody"
                assert connection.bind("cn=root", server.password, 10 * position + 2) == 0
        assert connection.search(9999) == (0, 1)
    return found


@pytest.fixture(scope="module", name="plain_codes")
def plain_codes_fixture(server):
    return codes_with(server, None)


def expected_codes(plain_codes, oid, critical, is_good):
    """`is_good`: whether the control is well formed where it is used."""
    used_for = CONTROLS[oid][0]
    if oid == MANAGE_DSA_IT:
        used_for = set(plain_codes)
    codes = {}
    for kind, plain in plain_codes.items():
        if kind not in used_for:
            codes[kind] = 12 if critical else plain
        else:
            codes[kind] = plain if is_good else 2
    return codes


@pytest.mark.parametrize("times", [1, 2])
@pytest.mark.parametrize("critical", [None, False, True])
@pytest.mark.parametrize("form", BAD_FORMS)
@pytest.mark.parametrize("oid", CONTROLS)
def test_control_in_every_form_is_heeded_ignored_or_refused(
        server, plain_codes, oid, form, critical, times):
    good = CONTROLS[oid][1]
    value = BAD_FORMS[form](good or b"x")
    is_good = times == 1 and value == good
    controls = [control(oid, critical, value)] * times
    before = server.config.read()
    assert codes_with(server, controls) == expected_codes(plain_codes, oid, critical, is_good)
    assert server.config.read() == before


@pytest.mark.parametrize("critical", [None, False, True])
@pytest.mark.parametrize("oid", CONTROLS)
def test_good_control_is_heeded_where_it_means_something_and_once(server, plain_codes, oid, critical):
    one = control(oid, critical, CONTROLS[oid][1])
    for times in (1, 2):
        assert codes_with(server, [one] * times) == expected_codes(
            plain_codes, oid, critical, times == 1)


@pytest.mark.parametrize("oid", CONTROLS)
def test_good_control_and_a_bad_one_of_its_kind_are_refused_in_either_order(server, plain_codes, oid):
    good = CONTROLS[oid][1]
    pair = [control(oid, True, good), control(oid, False, good[:-1] if good else b"x")]
    for controls in (pair, pair[::-1]):
        assert codes_with(server, controls) == expected_codes(plain_codes, oid, True, False)


# Nobody hears of an unbind or an abandon, so all that can go wrong is that it does harm.
@pytest.mark.parametrize("oid", CONTROLS)
def test_unbind_and_abandon_take_any_control_without_an_answer(server, good, oid):
    for critical in (None, True):
        for make in BAD_FORMS.values():
            controls = [control(oid, critical, make(CONTROLS[oid][1] or b"x"))] * 2
            with wire.Wire(server) as connection:
                connection.send(request(1, number(77, 0x50), controls)
                                + request(2, WHO_AM_I_REQUEST)
                                + request(3, Node(0x42, b""), controls)
                                + request(4, WHO_AM_I_REQUEST))
                answers = connection.answers_until_closed()
                assert [(answer.message_id, answer.code) for answer in answers] == [(2, 0)]


# ---- endless loops and numbers

def test_abandon_of_oneself_or_of_nothing_changes_nothing(root):
    for position, target in enumerate((2, 0, 1, 2**31 - 1, 6, 7), start=2):
        root.send(request(position, number(target, 0x50)))
    root.send(b"".join(request(20, number(20, 0x50)) for _ in range(100)))
    assert root.search(30) == (0, 1)


def test_abandon_of_an_abandoned_search_changes_nothing(root):
    position = 2
    for _ in range(50):
        root.send(request(position, search(scope=2)) + request(position + 1, number(position, 0x50))
                  + request(position + 2, number(position, 0x50))
                  + request(position + 3, number(position + 1, 0x50)))
        position += 4
    root.send(request(position, search()))
    while True:
        answer = root.answer()
        if answer.message_id == position and answer.tag == wire.SEARCH_DONE:
            break
    assert answer.code == 0


@pytest.mark.parametrize("octets", [b"\xff", b"\x80", b"\x80\0\0\0", b"\xff\xff\xff\xff",
                                    b"\0\x80\0\0\0", b"\x7f" + b"\xff" * 7, b"\x01" * 100, b""],
                         ids=lambda octets: octets[:9].hex() or "none")
def test_number_below_zero_or_beyond_its_range_is_refused(server, good, octets):
    strange = [Node(tag, octets) for tag in (0x02, 0x0A)]
    places = [search().content[:index] + [strange[index < 3]] + search().content[index + 1:]
              for index in (1, 2, 3, 4)]
    operations = [Node(0x63, parts) for parts in places]
    operations.append(Node(0x66, [text("cn=absent," + SCHEMAS), Node(0x30, [
        Node(0x30, [strange[1], attribute("cn", "x")])])]))
    operations.append(Node(0x60, [strange[0], text("cn=root"), text(server.password, 0x80)]))
    for operation in operations:
        with wire.Wire(server) as connection:
            if operation.tag != b"\x60":
                assert connection.bind("cn=root", server.password) == 0
            connection.send(request(2, operation))
            answer = answer_or_end(connection)
            assert answer is None or answer.code == 2


# ---- an operation after a failed one of each kind

def test_requests_after_a_failed_one_of_any_kind_are_served(server):
    with wire.Wire(server) as connection:
        for position, (kind, operation) in enumerate(every_operation().items()):
            if kind == "unbind":
                continue
            assert connection.bind("cn=root", server.password, 10 * position + 1) == 0
            connection.send(request(10 * position + 2, operation))
            if kind != "abandon":
                assert answer_or_end(connection).code != 0, kind
            expected = 50 if "bind" in kind else 0
            assert connection.search(10 * position + 3)[0] == expected, kind


# ---- passwords

def test_only_the_very_password_is_accepted(server):
    right = server.password.encode()
    wrong = {right[:-1], right[1:], right + b"\0", right + b" ", b" " + right, right * 2, right.upper(),
             right.lower(), right.swapcase(), right + b"\0" + right, b"\0", b"*", b"x" * 100000,
             b"{AES256}", b"%s" % right.hex().encode()} - {right}
    wrong |= {right[:i] + bytes([right[i] ^ 1 << bit]) + right[i + 1:]
              for i in (0, len(right) // 2, len(right) - 1) for bit in range(8)}
    with wire.Wire(server) as connection:
        for position, password in enumerate(sorted(wrong), start=1):
            if position % 8 == 0:  # a success forgets the failures, of which too many lock out
                assert connection.bind("cn=root", right.decode(), 1000 + position) == 0
            operation = Node(0x60, [number(3), text("cn=root"), Node(0x80, password)])
            connection.send(request(position, operation))
            assert connection.answer().code == 49, password
        assert connection.bind("cn=root", right.decode(), 5000) == 0


STORED = ["*", "", "{%s}x" % ("A" * 512), "{UNKNOWN}x", "{SSHA512}",
          "{SSHA512}!", "{SSHA512}" + "A" * 100000, "{AES256}", "{AES256}AAAA", "{CRYPT}", "{CRYPT}*0",
          "{CRYPT}$6$rounds=999999999$s$x", "{CRYPT}$y$jzT$abcdefghijklmnop$x",
          "{PBKDF2-SHA256}0$c2FsdA$x", "{PBKDF2-SHA256}4294967297$c2FsdA$MDEyMzQ1Njc4OTAxMjM0NQ",
          "{PBKDF2-SHA512}99999999999999999999$c2FsdA$MDEyMzQ1Njc4OTAxMjM0NQ", "{pbkdf2-sha256}-1$$"]


def test_malformed_stored_passwords_never_match_and_take_no_time(instance):
    for position, stored in enumerate(STORED):
        instance.config.add_member("stored%d" % position, stored, bind_dn="cn=stored%d" % position)
    instance.config.set(clients.BASE, "orv-slapdAdminGroupEnabled", "TRUE")
    instance.config.set("cn=pwdpolicy admin,cn=configuration", "pwdLockout", "FALSE")
    instance.config.set(clients.BASE, "orv-slapdMaxUnauthenticatedMessageSize", str(1 << 20))
    instance.start()
    used = Stopwatch(instance)
    for position, stored in enumerate(STORED):
        with wire.Wire(instance) as connection:
            guesses = {"x", "*", "secret", stored, stored.split("}")[-1]}
            for number_of_guess, guess in enumerate(sorted(guesses), start=1):
                code = connection.bind("cn=stored%d" % position, guess, number_of_guess)
                assert code == (53 if not guess else 49), (stored[:30], guess[:30])
    assert used.seconds() < 10 * SLOW
    wire.bound(instance).close()


# ---- secrets

def test_secret_in_failed_and_malformed_requests_is_written_nowhere(traced):  # noqa: F811
    for way, data in secret_requests():
        for who in ("cn=root", None):
            with wire.Wire(traced) as connection:
                if who:
                    assert connection.bind(who, traced.password) == 0
                connection.send(data)
                connection.shut_down_writing()
                for answer in connection.answers_until_closed():
                    assert MARKER.encode() not in answer.content, way
    traced.stop()
    texts = written(traced)
    assert all(len(texts[name]) > 10000 for name in ("access.log", "audit.log", "trace"))
    for name, content in texts.items():
        for form in (MARKER.lower().encode(), MARKER.encode().hex().encode()):
            where = content.lower().find(form)
            assert where < 0, (name, content[max(0, where - 300):where + 100])


def secret_requests():
    dn = member_dn("absent")
    wholes = {
        "bind": bind("cn=root", MARKER),
        "SASL bind": sasl_bind("PLAIN", "\0cn=root\0" + MARKER),
        "add": addition(dn, attribute("objectClass", "top", "orv-slapdConfigEntry",
                                      "orv-slapdAdminGroupMember"),
                        attribute("orv-slapdAdminPW", MARKER)),
        "modify": modification(dn, (2, "orv-slapdAdminPW", [MARKER])),
        "modify, by delete and add": modification(
            clients.BASE, (1, "orv-slapdAdminPW", [MARKER]), (0, "orv-slapdAdminPW", [MARKER + "2"])),
        "modify of a master": modification(dn, (0, "orv-slapdMasterPW", [MARKER])),
        "compare": Node(0x6E, [text(clients.BASE), Node(0x30, [text("orv-slapdAdminPW"), text(MARKER)])]),
        "search": search(search_filter=Node(0xA3, [text("orv-slapdAdminPW"), text(MARKER)])),
        "SCRAM": sasl_bind("SCRAM-SHA-256", "n,,n=%s,r=x" % MARKER),
        "DIGEST-MD5": sasl_bind("DIGEST-MD5", 'username="root",response=' + MARKER),
        "cancel": Node(0x77, [text(CANCEL, 0x80), text(MARKER, 0x81)]),
        "StartTLS": Node(0x77, [text("1.3.6.1.4.1.1466.20037", 0x80), text(MARKER, 0x81)]),
        "password modify": Node(0x77, [text("1.3.6.1.4.1.4203.1.11.1", 0x80), text(MARKER, 0x81)]),
    }
    for name, operation in wholes.items():
        data = request(2, operation)
        yield name, data
        yield name + ", cut", data[:-3]
        yield name + ", with a critical control", request(
            2, operation, [control("1.2.3", True, MARKER.encode())])
        # What is asserted of a password, or asked to be read, is as secret.
        for oid in (ASSERTION, PRE_READ, POST_READ, PAGED_RESULTS, PERSISTENT_SEARCH):
            for critical in (True, False):
                for value in (Node(0xA3, [text("orv-slapdAdminPW"), text(MARKER)]).encoded(),
                              Node(0x30, [text("orv-slapdAdminPW"), text(MARKER)]).encoded(),
                              page(b"\5", text(MARKER)), MARKER.encode()):
                    yield "%s, with %s" % (name, oid), request(
                        2, operation, [control(oid, critical, value)])
        yield name + ", with octets behind it", data + MARKER.encode()
        yield name + ", under another tag", request(2, Node(0x7E, operation.body()))
        yield name + ", in a version to come", request(2, Node(
            operation.tag, operation.content + [Node(0x9E, MARKER.encode())]
            if operation.is_set() else operation.content))
        for position, flipped in ((i, data[:i] + bytes([data[i] ^ 0x81]) + data[i + 1:])
                                  for i in range(2, len(data) - len(MARKER), 3)):
            if MARKER.encode() in flipped:
                yield "%s, octet %d changed" % (name, position), flipped


# ---- the audit log with short, long and binary values

def test_audit_log_keeps_its_form_whatever_values_are_sent(instance):
    instance.start()
    root = clients.bind(instance)
    values = [b"x" * length for length in (*range(1, 90), 1000, 65535, 500000)]
    values += [bytes([byte]) for byte in range(1, 256)]
    values += [b" x", b"x ", b":x", b"<x", b"\n", b"x\r\ndn: cn=y\nchangetype: delete\n", b"\xc3\xa4" * 40,
               b"\xff\xfe\0", b"-", b"#", "\u2028".encode(), b"x: y"]
    sent = []
    for position, value in enumerate(values):
        dn = "cn=v%d,%s" % (position, SCHEMAS)
        try:
            root.add_s(dn, [("objectClass", [b"top", b"container"]), ("cn", [b"v%d" % position]),
                            ("description", [value])])
        except ldap.LDAPError:
            pass
        sent.append((dn, value))
    root.unbind_s()
    instance.stop()
    found = dict(Records(log_of(instance)).records)
    wrong = [value[:50] for dn, value in sent if found[dn]["description"] != [value]]
    assert not wrong
    text_of_log = log_of(instance).read_bytes()
    assert not set(text_of_log) & (set(range(32)) | {127}) - set(b"\n\t"), "a control character"
