"""The record of changes: every attempt, with who, when, from where and with what result."""

import base64
import io
import os
import re
import signal
import stat
import time

import ldap
import ldif
import pytest

from orv_e2e import clients
from orv_e2e.changes import PLACE
from orv_e2e.programs import DEADLINE
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
    instance.stop()
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
    while b"the same file as the access log" not in (instance.directory / "error.log").read_bytes():
        clients.search(root)
    add_member(root, "alice")
    root.unbind_s()
    instance.stop()
    assert len(Records(log_of(instance)).records) == 5
    assert b"changetype" not in instance.access_log.read_bytes()


ENTRY = "cn=%s,cn=log management,cn=configuration"


def change_logs(instance, **paths):
    """Names other files for logs, takes that over, and gives what was said about it."""
    heard = instance.directory / "log" / "error.log"
    start = heard.stat().st_size
    for name, path in paths.items():
        instance.config.set(ENTRY % name, "orv-slapdLog", str(path))
    instance.process.send_signal(signal.SIGHUP)
    deadline = time.monotonic() + DEADLINE
    while not any(b"settings taken over" in path.read_bytes()[start if path == heard else 0:]
                  for path in (heard, *paths.values()) if path.is_file()):
        assert time.monotonic() < deadline
        time.sleep(0.01)
    return heard.read_bytes()[start:].decode()


@pytest.fixture
def with_error_log(instance):
    """An instance whose error log is a file."""
    heard = instance.directory / "log" / "error.log"
    instance.config.set(ENTRY % "default", "orv-slapdLog", str(heard))
    instance.config.set(ENTRY % "default", "orv-slapdLogLevel", "info")
    return instance.start()


def assert_apart(instance):
    """No line of one log is in the file of another."""
    for path in instance.directory.rglob("*"):
        if not path.is_file() or path.suffix not in (".log", ".1"):
            continue
        text = path.read_bytes()
        kinds = [b"changetype: " in text, b" conn=" in text, b" info " in text]
        assert kinds.count(True) <= 1, (path, text)


def change_something(instance):
    root = clients.bind(instance)
    add_member(root, "alice")
    root.delete_s(member_dn("alice"))
    root.unbind_s()


def test_logs_that_change_places_with_it_stay_where_they_are(with_error_log):
    instance = with_error_log
    heard = instance.directory / "log" / "error.log"
    change_something(instance)
    said = change_logs(instance, audit=heard, default=log_of(instance))
    assert "cannot record changes in %s: the same file as the error log" % heard in said
    assert "cannot log to %s: the same file as the audit log" % log_of(instance) in said
    change_something(instance)
    instance.stop()
    assert len(Records(log_of(instance)).records) == 4
    assert_apart(instance)


@pytest.mark.parametrize("kind", ["link", "folder", "own file", "no folder", "pipe"])
@pytest.mark.parametrize("other", ["default", "access"])
def test_no_log_takes_its_file_when_it_could_not_move(with_error_log, kind, other):
    instance = with_error_log
    wanted = instance.directory / "log" / "wanted"
    if kind == "link":
        wanted.symlink_to(instance.directory / "elsewhere")
    elif kind == "folder":
        wanted.mkdir()
    elif kind == "own file":
        wanted = instance.config.path
    elif kind == "no folder":
        wanted = wanted / "audit.log"
    else:
        os.mkfifo(wanted)
    change_something(instance)
    said = change_logs(instance, **{"audit": wanted, other: log_of(instance)})
    assert "cannot record changes in %s" % wanted in said
    assert "cannot log to %s: the same file as the audit log" % log_of(instance) in said
    change_something(instance)
    instance.stop()
    assert len(Records(log_of(instance)).records) == 4
    assert_apart(instance)


def test_no_log_takes_its_file_under_the_name_it_was_moved_to(with_error_log):
    instance = with_error_log
    change_something(instance)
    moved = log_of(instance).with_suffix(".1")
    log_of(instance).rename(moved)
    wanted = instance.directory / "nowhere" / "audit.log"
    said = change_logs(instance, audit=wanted, default=moved)
    assert "cannot log to %s: the same file as the audit log" % moved in said
    change_something(instance)
    instance.stop()
    assert len(Records(moved).records) == 4
    assert_apart(instance)


def test_it_may_move_and_another_log_take_its_place(with_error_log):
    instance = with_error_log
    old = log_of(instance)
    change_something(instance)
    old.rename(old.with_suffix(".1"))
    other = instance.directory / "log" / "other.log"
    change_logs(instance, audit=other, default=old)
    change_something(instance)
    instance.stop()
    assert len(Records(other).records) == 2
    assert_apart(instance)


def test_it_is_never_the_file_that_standard_error_goes_to(instance):
    """The daemon's own words would stand among the records."""
    log_of(instance).parent.mkdir(exist_ok=True)
    command = ["sh", "-c", 'exec "$@" 2>>"$0"', str(log_of(instance))]
    instance.start(wrapper=command)
    change_something(instance)
    instance.stop()
    text = log_of(instance).read_bytes()
    assert b"the same file as standard error" in text
    assert b"changetype" not in text


def test_an_attempt_to_rename_is_there(server, root):
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        root.rename_s(member_dn("alice"), "cn=bob", GROUP, delold=0)
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        root.rename_s(member_dn("alice"), "orv-slapdAdminPW=hidden")
    server.stop()
    log = Records(log_of(server))
    assert [dn for dn, _ in log.records] == [member_dn("alice")] * 2
    assert log.records[0][1] == {"changetype": [b"modrdn"], "newrdn": [b"cn=bob"],
                                 "deleteoldrdn": [b"0"], "newsuperior": [GROUP.encode()]}
    assert log.records[1][1] == {"changetype": [b"modrdn"],
                                 "newrdn": [b"orv-slapdAdminPW=********"], "deleteoldrdn": [b"1"]}
    assert [facts["operation"] for facts in log.facts] == ["rename", "rename"]
    assert [facts["result"] for facts in log.facts] == ["53", "53"]


class Modifications(ldif.LDIFParser):
    """The lists of the modify records of a log, as python3-ldap would send them again."""

    def __init__(self, path):
        super().__init__(io.BytesIO(path.read_bytes()))
        self.lists = []
        self.parse_change_records()

    def handle_modify(self, dn, modops, controls=None):
        self.lists.append((dn, modops))


VALUES = [b"short", b"x" * 5000, bytes(range(256)), b"\xff\xfe" * 2000, b" leading", b"trailing ",
          b":colon", b"<file:///etc/passwd", b"", "gr\u00fc\u00dfe".encode(), b"two\nlines",
          b"dn: cn=forged\nchangetype: delete", b"-", b"# comment", b"cr\rlf\r\n", b"\0", b"=,+"]


@pytest.mark.parametrize("code", [ldap.MOD_ADD, ldap.MOD_DELETE, ldap.MOD_REPLACE])
def test_modifications_come_back_as_they_were_sent(server, root, code):
    lists = [[(code, "description", [value])] for value in VALUES]
    lists.append([(code, "description", VALUES)])
    lists.append([(code, "description", [value]) for value in VALUES])
    lists.append([(ldap.MOD_DELETE, "description", None), (code, "DESCRIPTION", VALUES[:3]),
                  (ldap.MOD_REPLACE, "2.5.4.13", None), (code, "description;lang-de", [b"x"])])
    lists.append([(ldap.MOD_ADD, "description", [b"a", b"b"]),
                  (ldap.MOD_DELETE, "description", [b"a"]),
                  (ldap.MOD_REPLACE, "description", [b"c"])])
    for modifications in lists:
        try:
            root.modify_s(PLACE, modifications)
        except ldap.LDAPError:
            pass
    server.stop()  # what the server itself refuses may be answered before it is recorded
    found = Modifications(log_of(server)).lists
    assert [dn for dn, _ in found] == [PLACE] * len(lists)
    for (_, recorded), sent in zip(found, lists):
        assert recorded == sent


@pytest.mark.parametrize("value", [PASSWORD, b"y" * 5000, b"\xff binary\n", b"Kq8#vz7!Wb2$"])
def test_modifications_show_no_password_in_any_form(server, root, value):
    add_member(root, "alice")
    alice = clients.bind(server, "cn=alice", PASSWORD.decode())
    name = "orv-slapdAdminPW"
    lists = [[(ldap.MOD_REPLACE, name, [value])],
             [(ldap.MOD_DELETE, name, [value]), (ldap.MOD_ADD, name, [value])],
             [(ldap.MOD_ADD, name, [value, value + b"2"]), (ldap.MOD_DELETE, name, None)]]
    for client in (root, alice):
        for modifications in lists:
            try:
                client.modify_s(member_dn("alice"), modifications)
            except ldap.LDAPError:
                pass
    server.stop()
    text = log_of(server).read_bytes()
    folded = text.replace(b"\n ", b"")
    assert value not in folded and base64.b64encode(value).rstrip(b"=")[:-1] not in folded
    masked = [[(operation, kind, values and [b"********"] * len(values))
               for operation, kind, values in modifications] for modifications in lists]
    found = Modifications(log_of(server)).lists
    expected = masked * 2
    # A password that was changed ends the connection of whoever used the old one.
    assert [recorded for _, recorded in found] == expected[:len(found)]
    assert len(found) >= len(lists)


def test_it_can_be_switched_off(instance):
    instance.config.set("cn=audit,cn=log management,cn=configuration", "orv-slapdLogLevel", "off")
    instance.start()
    root = clients.bind(instance)
    add_member(root, "alice")
    assert not log_of(instance).exists()
