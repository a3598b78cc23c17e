"""Extended operations and SASL binds in every form: absent, empty, truncated, over-long, of another
type, repeated, and out of order. docs/security.md lists this with the other classes of defects.
"""

import base64
import hashlib
import hmac
import re
import socket
import ssl
from urllib.parse import unquote

import pytest

from orv_e2e import clients, wire
from orv_e2e.malformed import Node, flag, number, text
from orv_e2e.programs import DEADLINE
from test_hostile import CANCEL, SLOW, STORED, WHO_AM_I, Stopwatch, answer_or_end, request, search

START_TLS = "1.3.6.1.4.1.1466.20037"
USER = "boss"


@pytest.fixture(scope="module", name="server")
def server_fixture(module_instance):
    config = module_instance.config
    config.set(clients.BASE, "orv-slapdMaxUnauthenticatedMessageSize", str(1 << 20))
    config.set("cn=digest,cn=configuration", "orv-slapdDigestAdminUser", USER)
    config.set("cn=pwdpolicy admin,cn=configuration", "pwdLockout", "FALSE")
    return module_instance.start()


@pytest.fixture(name="root")
def root_fixture(server):
    with wire.bound(server) as connection:
        yield connection
        assert connection.search(9999) == (0, 1)


# ---- extended operations

def extended(oid, value=None, value_tag=0x81):
    parts = [text(oid, 0x80)]
    if value is not None:
        parts.append(text(value, value_tag))
    return Node(0x77, parts)


GOOD_CANCEL = Node(0x30, [number(4711)]).encoded()
MALFORMED_CANCELS = [
    None, b"", GOOD_CANCEL[:1], GOOD_CANCEL[:2], GOOD_CANCEL[:-1], GOOD_CANCEL + b"\0", GOOD_CANCEL * 2,
    b"\x31" + GOOD_CANCEL[1:], number(4711).encoded(), text(GOOD_CANCEL).encoded(),
    Node(0x30, []).encoded(), Node(0x30, [number(1), number(2)]).encoded(),
    Node(0x30, [text("1")]).encoded(), Node(0x30, [Node(0x02, b"")]).encoded(),
    Node(0x30, [number(-1)]).encoded(), Node(0x30, [number(-2**31)]).encoded(),
    Node(0x30, [number(2**31)]).encoded(), Node(0x30, [Node(0x02, b"\1" * 100)]).encoded(),
    b"\x30\x84\xff\xff\xff\xff", b"\x30\x80" * 300, b"x" * 100000]


@pytest.mark.parametrize("value", MALFORMED_CANCELS,
                         ids=lambda value: "absent" if value is None else value[:9].hex() or "empty")
def test_malformed_cancel_is_refused(root, value):
    root.send(request(2, extended(CANCEL, value)))
    assert root.answer().code == 2


@pytest.mark.parametrize("target,code", [(0, 119), (1, 119), (4711, 119), (2**31 - 1, 119), (3, 121)])
def test_cancel_of_nothing_or_of_itself_is_told_so_however_often(root, target, code):
    for _ in range(20):
        root.send(request(3, extended(CANCEL, Node(0x30, [number(target)]).encoded())))
        assert root.answer().code == code


# Each sees the other outstanding at most as something that cannot be canceled.
def test_cancels_of_each_other_all_end(root):
    count = 200
    root.send(b"".join(
        request(position, extended(CANCEL, Node(0x30, [number(target)]).encoded()))
        for position, target in zip(range(2, count + 2), [*range(3, count + 2), 2])))
    answers = [root.answer() for _ in range(count)]
    assert [answer.message_id for answer in answers] == list(range(2, count + 2))
    assert {answer.code for answer in answers} <= {119, 121}


@pytest.mark.parametrize("value", [b"", b"x", b"\0", GOOD_CANCEL, b"x" * 100000],
                         ids=lambda value: value[:9].hex() or "empty")
@pytest.mark.parametrize("oid", [WHO_AM_I, START_TLS])
def test_operation_without_a_value_is_refused_with_one(root, oid, value):
    root.send(request(2, extended(oid, value)))
    assert root.answer().code == 2
    root.send(request(3, extended(WHO_AM_I)))
    answer = root.answer()
    assert answer.code == 0 and b"dn:" in answer.content, "still in clear, and still bound"


@pytest.mark.parametrize("oid", [WHO_AM_I, START_TLS, CANCEL])
def test_name_of_an_operation_is_taken_to_the_letter(root, oid):
    for position, name in enumerate((oid + "\0", oid + " ", " " + oid, oid[:-1], oid + ".0", "0" + oid,
                                     oid + "\0x", "", "x" * 50000, "oid." + oid), start=2):
        root.send(request(position, extended(name)))
        assert root.answer().code == 2, name


@pytest.mark.parametrize("oid", [WHO_AM_I, START_TLS, CANCEL])
def test_request_of_another_form_is_no_such_request(server, oid):
    name, value = text(oid, 0x80), text(GOOD_CANCEL, 0x81)
    for parts in ([], [value], [value, name], [text(oid, 0x04)], [Node(0xA0, [text(oid)])],
                  [text("x", 0x04), name], [name, value, value]):
        with wire.bound(server) as connection:
            connection.send(request(2, Node(0x77, parts)))
            answer = answer_or_end(connection)
            assert answer is None or answer.code != 0


# RFC 4511, 4: what a later version may put behind the elements that are known is passed over.
@pytest.mark.parametrize("more", [text("x", 0x80), Node(0xAF, [text("x")])],
                         ids=["another name", "something to come"])
def test_element_behind_those_that_are_known_is_passed_over(root, more):
    root.send(request(2, Node(0x77, [text(WHO_AM_I, 0x80), more])))
    answer = root.answer()
    assert answer.code == 0 and b"dn:" in answer.content


@pytest.mark.parametrize("oid", ["1.3.6.1.1.12", "1.3.6.1.1.13.1", "1.3.6.1.1.13.2", "1.2.3.4",
                                 "1.2.840.113556.1.4.319", "2.16.840.1.113730.3.4.3"])
def test_start_tls_that_a_control_refuses_does_not_start_tls(server, oid):
    for value in ([], [text("")], [text("x" * 1000)]):
        with wire.Wire(server) as connection:
            refusing = Node(0x30, [text(oid), flag(True), *value])
            connection.send(request(1, extended(START_TLS), [refusing]))
            assert connection.answer().code == 12
            connection.send(request(2, extended(WHO_AM_I)))
            assert connection.answer().code == 0


def test_start_tls_behind_refused_ones_still_works(server):
    connection = wire.Wire(server)
    for position, value in enumerate(("", "x"), start=1):
        connection.send(request(position, extended(START_TLS, value)))
        assert connection.answer().code == 2
    connection.send(request(3, extended(START_TLS)))
    assert connection.answer().code == 0
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
    context.check_hostname, context.verify_mode = False, ssl.CERT_NONE
    connection.socket = context.wrap_socket(connection.socket)
    assert connection.bind("cn=root", server.password, 4) == 0
    connection.send(request(5, extended(START_TLS)))
    assert connection.answer().code == 1, "there is one TLS at a time"
    assert connection.search(6) == (0, 1)
    connection.close()


# ---- SASL: both sides of a bind by password, by hand

def scram_start(user):
    return b"n,,n=%s,r=aClientsNonce" % user


def scram_proof(_, first, challenge, password):
    fields = dict(part.split(b"=", 1) for part in challenge.split(b","))
    bare = b"c=biws,r=" + fields[b"r"]
    said = b",".join((first[3:], challenge, bare))
    salted = hashlib.pbkdf2_hmac("sha256", password, base64.b64decode(fields[b"s"]), int(fields[b"i"]))
    key = hmac.digest(salted, b"Client Key", "sha256")
    signature = hmac.digest(hashlib.sha256(key).digest(), said, "sha256")
    return bare + b",p=" + base64.b64encode(bytes(a ^ b for a, b in zip(key, signature)))


def digest_start(_):
    return None


def digest_proof(user, _, challenge, password):
    asked = dict(re.findall(rb'(\w+)="([^"]*)"', challenge))

    def md5(data):
        return hashlib.md5(data).digest()
    secret = md5(b":".join((user, asked[b"realm"], password)))
    a1 = md5(b":".join((secret, asked[b"nonce"], b"aClientsNonce"))).hex().encode()
    a2 = md5(b"AUTHENTICATE:ldap/localhost").hex().encode()
    response = md5(b":".join((a1, asked[b"nonce"], b"00000001", b"aClientsNonce", b"auth", a2))).hex()
    return (b'charset=utf-8,username="%s",realm="%s",nonce="%s",cnonce="aClientsNonce",nc=00000001,'
            b'qop=auth,digest-uri="ldap/localhost",response=%s'
            % (user, asked[b"realm"], asked[b"nonce"], response.encode()))


BY_PASSWORD = {"SCRAM-SHA-256": (scram_start, scram_proof), "DIGEST-MD5": (digest_start, digest_proof)}


class Exchange:
    """A bind by a mechanism with a password, on a connection, step by step."""

    def __init__(self, server, mechanism, user=USER, password=None):
        self.connection = wire.Wire(server)
        self.mechanism, self.user = mechanism, user.encode()
        self.password = (server.password if password is None else password).encode()
        self.start, self.prove = BY_PASSWORD[mechanism]
        self.position = 0

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.connection.close()

    def ask(self, operation):
        self.position += 1
        self.connection.send(request(self.position, operation))
        return answer_or_end(self.connection)

    def step(self, credentials, mechanism=None, name=""):
        parts = [text(mechanism or self.mechanism)]
        if credentials is not None:
            parts.append(text(credentials))
        return self.ask(Node(0x60, [number(3), text(name), Node(0xA3, parts)]))

    def begin(self):
        """The first step; gives the good answer to what the server asked."""
        self.first = self.start(self.user)
        answer = self.step(self.first)
        assert answer.code == 14
        return self.prove(self.user, self.first, credentials_of(answer), self.password)

    def is_anonymous(self):
        return self.ask(search()).code == 50

    def bind(self):
        proof = self.begin()
        answer = self.step(proof)
        if answer.code == 14:  # the server proves itself too
            answer = self.step(b"")
        return answer.code


def credentials_of(answer):
    return next(content for tag, content in wire.elements(answer.content) if tag == 0x87)


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_steps_in_order_bind(server, mechanism):
    with Exchange(server, mechanism) as exchange:
        assert exchange.bind() == 0
        assert exchange.ask(search()).code == 0


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_steps_out_of_order_prove_nothing(server, mechanism):
    with Exchange(server, mechanism) as exchange:
        proof = exchange.begin()
        assert exchange.step(proof + b"x").code == 49
        # The exchange has ended: the proof that was good in it is the first step of another.
        assert exchange.step(proof).code in (14, 49)
        assert exchange.step(proof).code in (14, 49)
        assert exchange.is_anonymous() or exchange.is_anonymous(), "1 ends an exchange, 50 follows"
        # Answers to a question that was asked anew.
        exchange.begin()
        assert exchange.ask(Node(0x60, [number(3), text(""), text("", 0x80)])).code == 0
        assert exchange.step(proof).code in (14, 49)
        exchange.ask(search())
        assert exchange.is_anonymous()
        # Nothing of all that is in the way of a bind.
        assert exchange.bind() == 0


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_whatever_comes_between_the_steps_ends_the_exchange(server, mechanism):
    between = {
        "search": search(), "who am I": extended(WHO_AM_I), "cancel": extended(CANCEL, GOOD_CANCEL),
        "StartTLS": extended(START_TLS), "simple bind": Node(0x60, [
            number(3), text("cn=root"), text("wrong", 0x80)]),
        "another mechanism": Node(0x60, [number(3), text(""), Node(0xA3, [text("NONE"), text("x")])]),
        "no mechanism": Node(0x60, [number(3), text(""), Node(0xA3, [text("")])]),
        "old version": Node(0x60, [number(2), text(""), text("", 0x80)]),
    }
    for name, operation in between.items():
        with Exchange(server, mechanism) as exchange:
            proof = exchange.begin()
            assert exchange.ask(operation).code != 0, name
            answer = exchange.step(proof)
            assert answer is None or answer.code in (14, 49), name
            if answer and answer.code == 14:
                exchange.ask(search())
            assert exchange.is_anonymous(), name


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_the_same_step_twice_proves_nothing(server, mechanism):
    with Exchange(server, mechanism) as exchange:
        first = exchange.start(exchange.user)
        assert exchange.step(first).code == 14
        second = exchange.step(first)
        assert second.code in (14, 49)
        if second.code == 14:
            exchange.ask(search())
        assert exchange.is_anonymous()
        assert exchange.bind() == 0


# The last step of an exchange that is bound already begins another, which nobody finishes.
@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_a_step_behind_the_last_one_binds_nobody(server, mechanism):
    for extra in (None, b"", b"x"):
        with Exchange(server, mechanism) as exchange:
            assert exchange.bind() == 0
            answer = exchange.step(extra)
            assert answer.code in (14, 49)
            if answer.code == 14:
                exchange.ask(search())
            assert exchange.is_anonymous()


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_steps_that_are_cut_or_over_long_prove_nothing(server, mechanism):
    with Exchange(server, mechanism) as exchange:
        whole = exchange.begin()
        assert exchange.step(b"").code in (14, 49)
        lengths = [0, 1, len(whole) // 2, len(whole) - 2, len(whole) - 1]
        forms = [lambda proof, length=length: proof[:length] for length in lengths]
        forms += [lambda proof: proof + b"\0", lambda proof: b"\0" + proof, lambda proof: proof * 2,
                  lambda proof: proof + b",x=" + b"y" * 70000, lambda proof: b"x" * 100000,
                  lambda proof: proof.replace(b"=", b"==", 1), lambda proof: None]
        for position, form in enumerate(forms):
            proof = exchange.begin()
            answer = exchange.step(form(proof))
            assert answer.code in (14, 49), position
            if answer.code == 14:
                assert exchange.step(proof).code in (14, 49)
                exchange.ask(search())
            assert exchange.is_anonymous(), position
        assert exchange.bind() == 0


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_steps_in_one_packet_are_steps_of_one_exchange(server, mechanism):
    """Whoever does not wait for the question cannot have answered it."""
    with Exchange(server, mechanism) as exchange:
        def step(position, credentials):
            return request(position, Node(0x60, [number(3), text(""), Node(0xA3, [
                text(mechanism), *([text(credentials)] if credentials is not None else [])])]))
        guess = b"c=biws,r=aClientsNonce,p=AAAA"
        exchange.connection.send(step(1, exchange.start(exchange.user)) + step(2, guess)
                                 + request(3, search()) + request(4, search()))
        answers = [answer_or_end(exchange.connection) for _ in range(4)]
        assert [answer.message_id for answer in answers] == [1, 2, 3, 4]
        assert [answer.code for answer in answers] == [14, 49, 50, 50]


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_malformed_stored_passwords_prove_no_user_name(instance, mechanism):
    for position, stored in enumerate(STORED):
        name = "stored%d" % position
        instance.config.add_member(name, stored, bind_dn="cn=" + name)
        instance.config.set("cn=%s,cn=admingroup,cn=configuration" % name,
                            "orv-slapdDigestAdminUser", name)
    instance.config.set("cn=digest,cn=configuration", "orv-slapdDigestAdminUser", USER)
    instance.config.set(clients.BASE, "orv-slapdAdminGroupEnabled", "TRUE")
    instance.config.set("cn=pwdpolicy admin,cn=configuration", "pwdLockout", "FALSE")
    instance.start()
    used = Stopwatch(instance)
    for position, stored in enumerate(STORED):
        for guess in ("", "x", "*", stored, stored.split("}")[-1]):
            with Exchange(instance, mechanism, "stored%d" % position, guess) as exchange:
                assert exchange.bind() == 49, (stored[:30], guess[:30])
                assert exchange.is_anonymous()
    assert used.seconds() < 10 * SLOW
    with Exchange(instance, mechanism) as exchange:
        assert exchange.bind() == 0


# ---- EXTERNAL, over the Unix socket, where it is good without credentials

class Local(wire.Wire):
    def __init__(self, instance):
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.socket.settimeout(DEADLINE)
        self.socket.connect(unquote(instance.local_url.split("://", 1)[1]))
        self._received = b""


@pytest.mark.parametrize("credentials", [
    b"\0", b"x", b"dn:", b"dn:cn=roo", b"dn:cn=root\0", b"dn:cn=nobody", b"u:", b"u:root\0", b"cn=root",
    b"dn:" + b"x" * 60000, b"\xff" * 60000], ids=lambda value: value[:9].hex() or "empty")
def test_external_acts_as_nobody_else_however_it_is_asked(server, credentials):
    bind = Node(0x60, [number(3), text(""), Node(0xA3, [text("EXTERNAL"), text(credentials)])])
    with Local(server) as connection:
        connection.send(request(1, bind) + request(2, search()))
        codes = [answer_or_end(connection).code for _ in range(2)]
        assert codes == [49, 50]


def test_external_binds_the_servers_user_in_one_step_or_in_two(server):
    def step(position, *credentials):
        return request(position, Node(0x60, [number(3), text(""), Node(0xA3, [
            text("EXTERNAL"), *credentials])]))
    for steps, codes in (([step(1, text(""))], [0]), ([step(1), step(2, text(""))], [14, 0]),
                         ([step(1), step(2, text("dn:cn=nobody"))], [14, 49])):
        with Local(server) as connection:
            connection.send(b"".join(steps) + request(3, search()))
            answers = [answer_or_end(connection).code for _ in range(len(steps) + 1)]
            assert answers == codes + [50 if codes[-1] else 0]


@pytest.mark.parametrize("method", [
    [], [text("")], [text("EXTERNAL\0")], [text("x" * 60000)], [text("")] * 2, [text("EXTERNAL")] * 3,
    [number(5)], [text("EXTERNAL"), number(5)], [Node(0x30, [text("EXTERNAL")])]],
    ids=lambda method: "-".join(node.encoded()[:9].hex() for node in method) or "nothing")
@pytest.mark.parametrize("connect", [Local, wire.Wire])
def test_malformed_sasl_credentials_bind_nobody(server, connect, method):
    with connect(server) as connection:
        connection.send(request(1, Node(0x60, [number(3), text(""), Node(0xA3, method)])))
        answer = answer_or_end(connection)
        if answer is not None:
            assert answer.code not in (0, 14)
            connection.send(request(2, search()))
            answer = answer_or_end(connection)
            assert answer is None or answer.code == 50
