"""A password that somebody sends in the wrong place is in no log, trace or message."""

import signal

import ldap
import pytest
from ldap.controls import RequestControl

from orv_e2e import clients, wire
from orv_e2e.changes import PLACE, encoded, numbers_of_classes, pass_through
from test_persistent_search import CLASSES, GROUP, add_member, member_dn

MARKER = "Marker-7f3a-secret"
ALL_TRACES = "0x04030000"
ASSERTION = "1.3.6.1.1.12"
PERSISTENT_SEARCH = "2.16.840.1.113730.3.4.3"


@pytest.fixture
def traced(instance):
    """A daemon that writes everything it can."""
    log = "cn=default,cn=log management,cn=configuration"
    instance.config.set(log, "orv-slapdLog", str(instance.directory / "log" / "error.log"))
    instance.config.set(log, "orv-slapdLogLevel", "debug")
    return instance.start("--debug", "--trace-mask", ALL_TRACES, "--trace-file",
                          str(instance.directory / "log" / "trace"))


def secret_names():
    number = numbers_of_classes()["orv-slapdAdminPW"]
    return ["orv-slapdAdminPW", "ORV-SLAPDADMINPW", "orv-slapdMasterPW", number]


def names_with_secret():
    """DNs that hold the marker as a password, in any part and any spelling."""
    found = []
    for name in secret_names():
        found += ["%s=%s,cn=configuration" % (name, MARKER),
                  "cn=x,%s=%s,cn=configuration" % (name, MARKER),
                  "cn=x,cn=y+%s=%s,cn=configuration" % (name, MARKER),
                  "%s=%s" % (name, MARKER)]
    found += ["cn=orv-slapdAdminPW\\3D%s\\2Co\\3Dx,cn=configuration" % MARKER,
              "orv-slapdAdminPW = \\4d%s , cn=configuration" % MARKER[1:],
              "orv-slapdAdminPW=%s\\,\\\"\\+,cn=configuration" % MARKER]
    return found


def broken_names():
    """What is no DN."""
    return ["orv-slapdAdminPW=%s,," % MARKER, "orv-slapdAdminPW=%s,cn" % MARKER, MARKER,
            "cn=x,,userPassword: %s" % MARKER, "=%s" % MARKER]


def attempt(operation, *arguments):
    try:
        operation(*arguments)
    except ldap.LDAPError:
        pass


def send_in_names(client):
    """In the name of everything that has one."""
    for dn in names_with_secret() + broken_names():
        for scope in (ldap.SCOPE_BASE, ldap.SCOPE_SUBTREE):
            attempt(client.search_s, dn, scope, "(objectClass=*)")
        attempt(client.add_s, dn, [("objectClass", [b"top", b"container"]), ("cn", b"x")])
        attempt(client.add_s, dn, [("objectClass", b"nonsense"), ("cn", b"x")])
        attempt(client.delete_s, dn)
        attempt(client.modify_s, dn, [(ldap.MOD_REPLACE, "description", [b"x"])])
        attempt(client.compare_s, dn, "cn", b"x")
        attempt(client.rename_s, dn, "cn=y")
        attempt(client.rename_s, GROUP, dn, dn)
        attempt(client.passwd_s, dn, None, MARKER)


def send_in_values(client):
    """As the value of what should hold it, might hold it, and should not."""
    marker = MARKER.encode()
    for name in secret_names() + ["orv-slapdAdminPW;x-a", "orv-slapdAdminPassword", "userPasswrod"]:
        for value in (marker, marker + b"\0", b"\xff" + marker, marker * 200):
            attempt(client.add_s, member_dn("alice"),
                    [("objectClass", CLASSES), ("cn", b"alice"), (name, value)])
            attempt(client.add_s, "cn=new," + PLACE,
                    [("objectClass", [b"top", b"container"]), ("cn", b"new"), (name, value)])
            for code in (ldap.MOD_ADD, ldap.MOD_DELETE, ldap.MOD_REPLACE):
                attempt(client.modify_s, member_dn("alice"), [(code, name, [value])])
            attempt(client.modify_s, member_dn("alice"),
                    [(ldap.MOD_DELETE, name, [value]), (ldap.MOD_ADD, name, [b"x", value])])
        attempt(client.compare_s, member_dn("alice"), name, marker)
    for dn in names_with_secret() + broken_names()[:2]:
        attempt(client.add_s, member_dn("bob"), [
            ("objectClass", CLASSES), ("cn", b"bob"), ("orv-slapdAdminDN", dn.encode())])
        attempt(client.modify_s, member_dn("alice"),
                [(ldap.MOD_REPLACE, "orv-slapdAdminDN", [dn.encode()])])


def send_in_pass_through(client):
    """Whose refusals name what was wrong."""
    secret = "orv-slapdAdminPW=%s" % MARKER
    for url in ("ldap://h", "ldap://h/%s??x?y?z?" % secret, "ldap://h/%s" % secret, secret,
                "foo:" + secret, "ldap://h/" + secret.replace("=", "%3d")):
        for subtrees in (["cn=configuration"], [secret + ",o=a", "ou=b,%s,o=a" % secret],
                         [secret + ",cn=configuration"], [secret + ",,"], [secret]):
            for parent in ("cn=passthrough authentication,cn=configuration",
                           secret + ",cn=passthrough authentication,cn=configuration"):
                _, attributes = pass_through("z", *subtrees, url=url)
                attempt(client.add_s, "cn=z," + parent, encoded(attributes))


def escaped(text):
    return "".join("\\%02x" % byte if chr(byte) in "\\*()" else chr(byte)
                   for byte in text.encode())


def send_in_filters(client):
    for name in secret_names() + ["orv-slapdAdminPW;x-a", "orv-slapdAdminPassword",
                                  "1.2.3.4", "orv-slapdAdminPW:caseExactMatch:", ":caseExactMatch:",
                                  "orv-slapdAdminPW:dn:"]:
        for item in ("%s=%s", "%s=*%s*", "%s=%s*", "%s>=%s", "%s<=%s", "%s~=%s"):
            text = "(%s)" % (item % (name, MARKER))
            for whole in (text, "(&(objectClass=*)(!%s))" % text, "(|%s%s)" % (text, text),
                          "(|(cn=%s)%s)" % ("x" * 990, text)):
                attempt(client.search_s, clients.BASE, ldap.SCOPE_SUBTREE, whole)
    for name in ("orv-slapdAdminDN", "member", "cn"):
        for dn in names_with_secret():
            text = "(%s=%s)" % (name, escaped(dn))
            attempt(client.search_s, clients.BASE, ldap.SCOPE_SUBTREE, text)
            for cut in range(1000, 1030, 3):
                attempt(client.search_s, clients.BASE, ldap.SCOPE_BASE,
                        "(|(cn=%s)%s)" % ("x" * (cut - len(text)), text))
    for dn in broken_names():
        attempt(client.search_s, clients.BASE, ldap.SCOPE_SUBTREE,
                "(orv-slapdAdminDN=%s)" % escaped(dn))


def send_in_binds(instance):
    for dn in names_with_secret() + broken_names() + ["cn=root"]:
        attempt(clients.connect(instance).simple_bind_s, dn, MARKER)
    attempt(clients.connect(instance).simple_bind_s, "orv-slapdAdminPW=%s,," % MARKER, "x")
    with wire.Wire(instance) as raw:
        sasl = wire.tlv(0xA3, wire.octets("PLAIN") + wire.octets("\0cn=root\0" + MARKER))
        raw.send(wire.message(1, wire.tlv(wire.BIND, wire.number(3) + wire.octets("cn=root")
                                          + sasl)))
        raw.answer()
        raw.send(wire.bind_request(2, MARKER, "")[:-4] + b"\xff\xff\xff\xff")
    with wire.Wire(instance) as raw:
        raw.send(wire.message(1, wire.tlv(0x77, wire.octets("1.3.6.1.4.1.4203.1.11.1", 0x80)
                                          + wire.octets(MARKER, 0x81))))
        raw.answer()


def send_in_controls(client):
    value = wire.equal("orv-slapdAdminPW", MARKER)
    for control in (RequestControl(ASSERTION, False, value), RequestControl(ASSERTION, True, value),
                    RequestControl(PERSISTENT_SEARCH, True, MARKER.encode()),
                    RequestControl("1.2.3.4", False, MARKER.encode())):
        attempt(client.search_ext_s, clients.BASE, ldap.SCOPE_BASE, "(objectClass=*)", None, 0,
                [control])
        attempt(client.delete_ext_s, member_dn("nobody"), [control])
        attempt(client.modify_ext_s, member_dn("nobody"),
                [(ldap.MOD_REPLACE, "description", [b"x"])], [control])


def written(instance):
    """Everything that the daemon wrote, by name."""
    texts = {path.name: path.read_bytes() for path in (instance.directory / "log").iterdir()}
    texts["standard error"] = instance.stderr.text().encode()
    texts["standard output"] = instance.stdout.text().encode()
    return texts


def test_a_password_in_the_wrong_place_is_written_nowhere(traced):
    root = clients.bind(traced)
    add_member(root, "alice")
    for client in (root, clients.connect(traced)):
        send_in_names(client)
        send_in_values(client)
        send_in_filters(client)
        send_in_pass_through(client)
        send_in_controls(client)
    send_in_binds(traced)
    # A configuration that is read while it holds one.
    traced.config.append(b"dn: cn=x,orv-slapdAdminPW=%s,,\ncn: x\n" % MARKER.encode())
    traced.process.send_signal(signal.SIGHUP)
    attempt(clients.search, root)
    root.unbind_s()
    traced.stop()
    texts = written(traced)
    assert {"access.log", "audit.log", "error.log", "trace"} <= set(texts)
    assert all(len(texts[name]) > 10000 for name in ("access.log", "audit.log", "trace"))
    lines = [(name, line) for name, text in texts.items() for line in text.split(b"\n")
             if MARKER.lower().encode()[1:] in line.lower()]
    assert not lines, "\n".join("%s: %r" % line for line in lines[:40])


def test_names_of_unknown_types_are_logged_without_their_values(server):
    """Somebody's password, under the name that it has elsewhere."""
    for client in (clients.bind(server), clients.connect(server)):
        for name in ("userPassword", "orv-slapdAdminPassword", "1.2.3.4"):
            dn = "cn=x+%s=%s,cn=configuration" % (name, MARKER)
            for base in (dn, "cn=y," + dn, "%s=%s" % (name, MARKER)):
                attempt(client.search_s, base, ldap.SCOPE_BASE)
                attempt(client.add_s, base, [("objectClass", [b"top", b"container"])])
                attempt(client.delete_s, base)
                attempt(client.modify_s, base, [(ldap.MOD_REPLACE, "description", [b"x"])])
                attempt(client.rename_s, base, "cn=y")
                attempt(client.rename_s, GROUP, base, base)
                attempt(client.compare_s, base, "cn", b"x")
                attempt(client.simple_bind_s, base, "wrong")
    server.stop()
    texts = written(server)
    assert not [name for name, text in texts.items() if MARKER.encode() in text]
    assert b'dn="userPassword=********"' in texts["access.log"]
    assert b"dn: userPassword=********\n" in texts["audit.log"]


def test_what_the_access_log_shows_of_names_and_filters(server):
    root = clients.bind(server)
    attempt(root.delete_s, "orv-slapdAdminPW=%s,," % MARKER)
    attempt(root.delete_s, "cn=x,orv-slapdAdminPW=%s,cn=configuration" % MARKER)
    attempt(root.delete_s, "CN=Nobody, cn=configuration")
    attempt(root.search_s, clients.BASE, ldap.SCOPE_BASE,
            "(|(cn=a)(orv-slapdAdminPasswd=b)(orv-slapdAdminDN=orv-slapdAdminPW=c)"
            "(orv-slapdAdminDN=cn=d)(orv-slapdAdminDN=*))")
    root.unbind_s()
    server.stop()
    text = server.access_log.read_text()
    assert ' DELETE dn="not a DN" result=34 ' in text
    assert ' DELETE dn="cn=x,orv-slapdAdminPW=********,cn=configuration" result=' in text
    assert ' DELETE dn="CN=Nobody, cn=configuration" result=32 ' in text
    assert ('filter="(|(cn=a)(orv-slapdAdminPasswd=***)(orv-slapdAdminDN=***)'
            '(orv-slapdAdminDN=cn=d)(orv-slapdAdminDN=*))"') in text
