"""The record of changes: every attempt, with who, when, from where and with what result."""

import io
import os
import re
import signal
import stat

import ldap
import ldif
import pytest

from orv_e2e import clients
from test_persistent_search import CLASSES, PASSWORD, GROUP, add_member, member_dn


class Records(ldif.LDIFParser):
    """Reads a log as LDIF, and the comments that stand before each record."""

    def __init__(self, path):
        text = path.read_bytes()
        super().__init__(io.BytesIO(text))
        self.records = []
        self.parse_entry_records()
        changes = ldif.LDIFParser(io.BytesIO(text))
        changes.parse_change_records()
        assert changes.records_read == len(self.records)
        blocks = [block for block in text.decode().split("\n\n") if "dn:" in block]
        assert len(blocks) == len(self.records)
        self.facts = [dict(re.findall(r"^# ([a-z-]+): (.*)$", block, re.MULTILINE))
                      for block in blocks]

    def handle(self, dn, entry):
        self.records.append((dn, entry))


def log_of(instance):
    return instance.directory / "log" / "audit.log"


def test_an_accepted_change_is_there_when_its_client_hears_of_it(server, root):
    add_member(root, "alice")
    log = Records(log_of(server))
    (dn, entry), facts = log.records[-1], log.facts[-1]
    assert dn == member_dn("alice")
    assert entry["changetype"] == [b"add"]
    assert entry["objectClass"] == CLASSES
    assert entry["orv-slapdAdminPW"] == [b"********"]
    assert facts["bind-dn"] == "CN=ROOT"
    assert facts["operation"] == "add"
    assert facts["result"] == "0"
    assert facts["client"].startswith("127.0.0.1:")
    assert re.match(r"^\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z$", facts["time"])
    root.delete_s(member_dn("alice"))
    log = Records(log_of(server))
    assert log.records[-1] == (member_dn("alice"), {"changetype": [b"delete"]})
    assert len(log.records) == 2


def test_refused_changes_are_there_too(instance):
    instance.start()
    root = clients.bind(instance)
    with pytest.raises(ldap.NO_SUCH_OBJECT):
        root.delete_s(member_dn("nobody"))
    with pytest.raises(ldap.LDAPError):
        root.add_s(member_dn("x"), [("objectClass", b"nonsense"), ("cn", b"x")])
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.connect(instance).delete_s(member_dn("nobody"))
    with pytest.raises(ldap.LDAPError):
        root.modify_s(GROUP, [(ldap.MOD_REPLACE, "description", [b"x"]),
                              (ldap.MOD_DELETE, "cn", None)])
    with pytest.raises(ldap.INVALID_DN_SYNTAX):
        root.delete_s("orv-slapdAdminPW=%s,," % PASSWORD.decode())
    root.unbind_s()
    instance.stop()
    log = Records(log_of(instance))
    results = sorted(facts["operation"] + " " + facts["result"] for facts in log.facts)
    assert len(results) == 5
    assert "delete 32" in results and "delete 50" in results and "delete 34" in results
    assert not [result for result in results if result.endswith(" 0")]
    outsider = [facts for facts in log.facts if facts["result"] == "50"][0]
    assert "bind-dn" not in outsider  # "# bind-dn:" without a value


def test_no_secret_is_ever_in_it(instance):
    instance.start()
    root = clients.bind(instance)
    marker = b"Marker-7f3a-secret"
    add_member(root, "alice")
    oid = clients.read(root, "cn=subschema", ["attributeTypes"])["attributeTypes"]
    number = [text.split()[1] for text in oid if b"'orv-slapdAdminPW'" in text][0].decode()
    for name in ("orv-slapdAdminPW", "ORV-SLAPDADMINPW", number, "orv-slapdAdminPW;x-a",
                 "orv-slapdMasterPW", "orv-slapdAdminPassword"):
        with pytest.raises(ldap.LDAPError):
            root.add_s(member_dn("alice"), [("objectClass", CLASSES), ("cn", b"alice"),
                                            (name, marker)])
        with pytest.raises(ldap.LDAPError):
            root.modify_s(member_dn("alice"), [(ldap.MOD_ADD, name, marker),
                                               (ldap.MOD_DELETE, name, marker)])
    for dn in ("orv-slapdAdminPW=%s,cn=configuration", "cn=x,ORV-slapdadminpw=%s,cn=configuration",
               number + "=%s,cn=configuration", "orv-slapdAdminPW=%s,,"):
        with pytest.raises(ldap.LDAPError):
            root.delete_s(dn % marker.decode())
    with pytest.raises(ldap.LDAPError):
        root.add_s(member_dn("alice"), [
            ("objectClass", CLASSES),
            ("orv-slapdAdminDN", b"orv-slapdAdminPW=" + marker + b",o=x")])
    root.unbind_s()
    instance.stop()
    text = log_of(instance).read_bytes()
    assert marker not in text and PASSWORD not in text
    assert len(Records(log_of(instance)).records) == 18


def test_values_that_ldif_cannot_hold_come_back_as_they_were(server, root):
    value = "zwei\nZeilen; dn: cn=x ü ".encode()
    with pytest.raises(ldap.LDAPError):
        root.add_s("cn=x,cn=nowhere,cn=configuration",
                   [("objectClass", [b"top", b"container"]), ("cn", b"x"),
                    ("description", [value, b" leading", b":colon", b"x" * 5000])])
    dn, entry = Records(log_of(server)).records[-1]
    assert entry["description"] == [value, b" leading", b":colon", b"x" * 5000]


def test_it_is_its_owners_only(server):
    assert stat.S_IMODE(os.stat(log_of(server)).st_mode) == 0o600


def test_a_file_that_was_moved_away_is_made_anew_at_sighup(server, root):
    add_member(root, "alice")
    moved = log_of(server).with_suffix(".1")
    log_of(server).rename(moved)
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "settings taken over" in line)
    root.delete_s(member_dn("alice"))
    assert [entry["changetype"] for _, entry in Records(moved).records] == [[b"add"]]
    assert [entry["changetype"] for _, entry in Records(log_of(server)).records] == [[b"delete"]]


def test_a_symbolic_link_is_not_followed(instance):
    target = instance.directory / "precious"
    target.write_bytes(b"precious")
    log_of(instance).parent.mkdir(exist_ok=True)
    log_of(instance).symlink_to(target)
    instance.start()
    root = clients.bind(instance)
    add_member(root, "alice")
    root.delete_s(member_dn("alice"))
    assert target.read_bytes() == b"precious"
    assert instance.stderr.wait_for(lambda line: "cannot record changes" in line)
    lost = [line for line in instance.stderr.lines() if "made without record" in line]
    assert len(lost) == 1


def test_it_is_never_a_file_of_the_servers_own(instance):
    for name in ("config.ldif", "key.stash", "admin.pw"):
        before = (instance.directory / name).read_bytes()
        instance.config.set("cn=audit,cn=log management,cn=configuration", "orv-slapdLog",
                            str(instance.directory / "log" / ".." / name))
        content = (instance.directory / name).read_bytes()
        instance.start()
        root = clients.bind(instance)
        with pytest.raises(ldap.NO_SUCH_OBJECT):
            root.delete_s(member_dn("nobody"))
        assert instance.stderr.wait_for(lambda line: "cannot record changes" in line)
        instance.stop()
        assert (instance.directory / name).read_bytes() == content
        assert name == "config.ldif" or before == content


def test_no_other_log_shares_its_file(instance):
    entry = "cn=%s,cn=log management,cn=configuration"
    instance.config.set(entry % "default", "orv-slapdLog", str(log_of(instance)))
    for _ in range(2):  # when the file is made, and when it is there
        instance.start()
        root = clients.bind(instance)
        add_member(root, "alice")
        root.delete_s(member_dn("alice"))
        root.unbind_s()
        instance.stop()
    assert len(Records(log_of(instance)).records) == 4
    # The file of a log that is open does not become the audit log, at least until that has moved.
    instance.config.set(entry % "default", "orv-slapdLog", str(instance.directory / "error.log"))
    instance.config.set(entry % "default", "orv-slapdLogLevel", "info")
    instance.start()
    instance.config.set(entry % "audit", "orv-slapdLog", str(instance.access_log))
    instance.process.send_signal(signal.SIGHUP)
    root = clients.bind(instance)
    while b"another log is there" not in (instance.directory / "error.log").read_bytes():
        clients.search(root)
    add_member(root, "alice")
    root.unbind_s()
    instance.stop()
    assert len(Records(log_of(instance)).records) == 5
    assert b"changetype" not in instance.access_log.read_bytes()


def test_it_can_be_switched_off(instance):
    instance.config.set("cn=audit,cn=log management,cn=configuration", "orv-slapdLogLevel", "off")
    instance.start()
    root = clients.bind(instance)
    add_member(root, "alice")
    assert not log_of(instance).exists()
