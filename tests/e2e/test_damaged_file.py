"""Configuration files that cannot be read, at start and while the server runs."""

import base64
import os
import re

import ldap
import pytest

from orv_e2e import clients
from orv_e2e.config_file import ldif_line, record

FAILED = ["Binding to config failed! rc = 1 ", "Turn on ldtrc for detail errors"]
SHELF = "cn=shelf,cn=schemas,cn=configuration"
CONTAINER = ("objectClass", ["top", "container"])


def damaged_entry(*lines, dn=SHELF):
    """A change that appends an entry with raw lines; gives the offset of the bad one, if any."""
    def change(text):
        return text + b"\n" + record(dn, [CONTAINER, ("cn", "shelf")]) + b"".join(
            line + b"\n" for line in lines)
    return change


def in_top_entry(line):
    """A change that puts one more line at the start of the first entry, after its DN."""
    def change(text):
        return re.sub(rb"(?im)^(dn:\s*cn=configuration\r?\n)", rb"\g<1>" + line.replace(
            b"\\", b"\\\\") + b"\n", text, count=1)
    return change


# What is done to the text, and what of the cause the message has to name. "@LAST" in the place of
# a line number stands for the last line of the damaged file.
DAMAGES = {
    "empty": (lambda text: b"", None),
    "only comments": (lambda text: b"# nothing\n\n", None),
    "only blanks": (lambda text: b"\n\n\n", None),
    "cut in an attribute name": (
        lambda text: text + b"\n" + record(SHELF, [CONTAINER]) + b"descri", "@LAST"),
    "cut in a value": (lambda text: text[:-4], "@LAST"),
    "cut in a DN": (lambda text: text + b"\n" + record(SHELF, [])[:-20], "@LAST"),
    "cut after a DN": (lambda text: text + b"\n" + record(SHELF, []), "@LAST"),
    "cut in the first line": (lambda text: b"dn: cn=confi", "1"),
    "DN twice": (
        lambda text: text + b"\n" + record("CN=Digest , cn=CONFIGURATION", [CONTAINER, (
            "cn", "digest")]), None),
    "child before its parent": (
        lambda text: text + b"\n" + record("cn=child," + SHELF, [CONTAINER, ("cn", "child")])
        + b"\n" + record(SHELF, [CONTAINER, ("cn", "shelf")]), None),
    "child without a parent": (
        lambda text: text + b"\n" + record("cn=child,cn=missing,cn=configuration", [
            CONTAINER, ("cn", "child")]), None),
    "invalid base64": (damaged_entry(b"description:: ????"), "@LAST"),
    "base64 of a wrong length": (damaged_entry(b"description:: QUJ"), "@LAST"),
    "NUL byte": (damaged_entry(b"description: a\0b"), "@LAST"),
    "NUL byte in base64": (damaged_entry(ldif_line("description", b"a\0b")[:-1]), "@LAST"),
    "nothing but NUL bytes": (lambda text: b"\0" * 4096, "1"),
    "line without a colon": (damaged_entry(b"description without a colon"), "@LAST"),
    "continuation of nothing": (lambda text: b" folded\n" + text, "1"),
    "DN that is none": (
        lambda text: text + b"\n" + record("cn=shelf,,cn=configuration", [CONTAINER]), None),
    "object class by its number": (
        damaged_entry(b"objectClass: 2.16.840.1.113730.3.2.6"), "@LAST"),
    "object class with a blank behind it": (damaged_entry(b"objectClass: referral "), "@LAST"),
    "object class by its number in base64": (
        damaged_entry(b"objectClass:: " + base64.b64encode(b"2.16.840.1.113730.3.2.6")), "@LAST"),
    "value from a file": (damaged_entry(b"description:< file:///etc/hostname"), "@LAST"),
    "change record": (
        lambda text: text + b"\ndn: " + SHELF.encode() + b"\nchangetype: delete\n", "@LAST"),
    "option on a secret": (in_top_entry(b"orv-slapdAdminPW;lang-en: SECRETMARK"), None),
    "option on a secret in base64": (
        in_top_entry(b"orv-slapdAdminPW;x-a:: " + base64.b64encode(b"SECRETMARK")), None),
}

CONTENT_MARK = "SECRETMARK"


def secret_by_oid(instance):
    """The numeric name of the administrator's password attribute, from the schema in force."""
    client = clients.connect(instance)
    root_dse = client.search_s("", ldap.SCOPE_BASE, attrlist=["subschemaSubentry"])[0][1]
    subschema = root_dse["subschemaSubentry"][0].decode()
    found = client.search_s(subschema, ldap.SCOPE_BASE, "(objectClass=subschema)",
                            ["attributeTypes"])[0][1]
    for description in found["attributeTypes"]:
        match = re.search(rb"\( *([0-9.]+) NAME '?orv-slapdAdminPW'", description)
        if match:
            return match.group(1)
    raise AssertionError("the schema does not describe the password")


def assert_clear_message(stderr, instance, line):
    assert str(instance.config.path) in stderr, stderr
    assert CONTENT_MARK not in stderr
    if line is not None:
        assert re.search(r"(line |:)%s\b" % line, stderr), (line, stderr)


@pytest.mark.parametrize("damage", DAMAGES)
def test_start_refuses_a_file_that_is(instance, damage):
    change, line = DAMAGES[damage]
    instance.config.replace(change(instance.config.read()))
    if line == "@LAST":
        line = str(len(instance.config.read().splitlines()))
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert_clear_message(stderr, instance, line)


def test_message_for_a_duplicate_names_the_second_place(instance):
    instance.config.add("cn=DIGEST,cn=configuration", [CONTAINER, ("cn", "digest")])
    last_record = len(instance.config.read().splitlines()) - 3
    _, stderr = instance.start_refused()
    assert re.search(r"(line |:)%d\b" % last_record, stderr), stderr


def test_message_for_an_orphan_names_its_place(instance):
    instance.config.add("cn=child," + SHELF, [CONTAINER, ("cn", "child")])
    place = instance.config.line_of("cn=child," + SHELF)
    instance.config.add(SHELF, [CONTAINER, ("cn", "shelf")])
    _, stderr = instance.start_refused()
    assert re.search(r"(line |:)%d\b" % place, stderr), stderr


def test_start_refuses_a_secret_under_its_numeric_name(instance):
    instance.start()
    oid = secret_by_oid(instance)
    instance.stop()
    instance.config.replace(in_top_entry(oid + b": SECRETMARK")(instance.config.read()))
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert_clear_message(stderr, instance, instance.config.line_of(clients.BASE) + 1)


def test_start_refuses_a_missing_file(instance):
    instance.config.path.unlink()
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert_clear_message(stderr, instance, None)
    assert os.strerror(2) in stderr


def test_start_refuses_a_folder_in_place_of_the_file(instance):
    instance.config.path.unlink()
    instance.config.path.mkdir()
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert_clear_message(stderr, instance, None)


def test_start_refuses_a_pipe_in_place_of_the_file_without_waiting_for_a_writer(instance):
    instance.config.path.unlink()
    os.mkfifo(instance.config.path)
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert_clear_message(stderr, instance, None)


def without_override():
    """What takes root's right to read everything away, so that file modes mean something."""
    if os.geteuid() != 0:
        return []
    return ["setpriv", "--bounding-set=-dac_override,-dac_read_search",
            "--inh-caps=-dac_override,-dac_read_search"]


def test_start_refuses_a_file_that_it_may_not_read(instance):
    instance.config.path.chmod(0)
    exit_code, stderr = instance.start_refused(wrapper=without_override())
    assert exit_code == 1
    assert_clear_message(stderr, instance, None)
    assert os.strerror(13) in stderr


def test_start_refuses_a_key_stash_that_others_may_read(instance):
    instance.key_stash.chmod(0o644)
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert str(instance.key_stash) in stderr


@pytest.mark.parametrize("content", [b"", b"orv-key-1 \n", b"orv-key-1 " + b"zz" * 32 + b"\n",
                                     b"orv-key-9 " + b"5a" * 32 + b"\n"])
def test_start_refuses_a_damaged_key_stash(instance, content):
    instance.key_stash.write_bytes(content)
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert str(instance.key_stash) in stderr
    assert "5a5a" not in stderr


def test_start_refuses_an_unusable_setting_and_names_it(instance):
    instance.config.set(clients.BASE, "orv-slapdSizeLimit", "many")
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert "orv-slapdSizeLimit" in stderr


# While it runs.

def search_code(client):
    return clients.code_of(clients.search, client, scope=ldap.SCOPE_BASE)


def put_folder(instance):
    instance.config.path.unlink()
    instance.config.path.mkdir()


def put_text(change):
    def put(instance):
        instance.config.replace(change(instance.config.read()))
    return put


WHILE_RUNNING = {
    "missing": lambda instance: instance.config.path.unlink(),
    "a folder": put_folder,
    **{name: put_text(change) for name, (change, _) in DAMAGES.items()},
}


def put_back(instance, text):
    if instance.config.path.is_dir():
        instance.config.path.rmdir()
    instance.config.replace(text)
    instance.config.path.chmod(0o600)


def failure_lines(server):
    return [line for line in server.stderr.lines() if line in FAILED]


@pytest.fixture(scope="module", name="running")
def running_fixture(module_instance):
    return module_instance.start()


@pytest.mark.parametrize("damage", WHILE_RUNNING)
def test_running_server_answers_1_and_serves_again_once_the_file_is_not(running, damage):
    whole = running.config.read()
    before = len(failure_lines(running))
    early = clients.bind(running)
    WHILE_RUNNING[damage](running)
    try:
        assert search_code(early) == 1
        late = clients.bind(running)
        assert search_code(late) == 1
        assert search_code(early) == 1
        assert search_code(clients.connect(running)) == 50
    finally:
        put_back(running, whole)
    assert search_code(early) == 0
    assert search_code(late) == 0
    assert clients.parse_ldif(whole).keys() == clients.search(early).keys()
    assert failure_lines_after(running, before) == FAILED * 3


def failure_lines_after(server, before):
    """The lines of three failed sessions, waited for: the collector may lag behind the answers."""
    while True:
        seen = len(server.stderr.lines())
        lines = failure_lines(server)[before:]
        if len(lines) >= 6:
            return lines
        server.stderr.wait_for(lambda _: True, 5, seen)


def test_file_that_becomes_unreadable_is_answered_1(instance):
    instance.start(wrapper=without_override())
    client = clients.bind(instance)
    instance.config.path.chmod(0)
    assert search_code(client) == 1
    instance.config.path.chmod(0o600)
    assert search_code(client) == 0


def test_key_stash_that_goes_away_is_answered_1(instance):
    instance.start()
    client = clients.bind(instance)
    hidden = instance.key_stash.with_suffix(".hidden")
    instance.key_stash.rename(hidden)
    assert search_code(client) == 1
    hidden.rename(instance.key_stash)
    assert search_code(client) == 0


def test_many_clients_are_served_again_after_a_damage(running):
    whole = running.config.read()
    connections = [clients.bind(running) for _ in range(8)]
    try:
        running.config.path.write_bytes(b"dn: cn=confi")
        assert {search_code(client) for client in connections} == {1}
    finally:
        put_back(running, whole)
    assert {search_code(client) for client in connections} == {0}


def test_server_stops_in_order_while_the_file_is_damaged(instance):
    instance.start()
    client = clients.bind(instance)
    instance.config.path.write_bytes(b"")
    assert search_code(client) == 1
    instance.stop()


# Unusual but well formed.

def mixed_line_ends(text):
    lines = text.split(b"\n")
    return b"\n".join(line + b"\r" if number % 2 and number < len(lines) - 1 else line
                      for number, line in enumerate(lines))


ACCEPTED = {
    "a byte-order mark": lambda text: b"\xef\xbb\xbf" + text,
    "mixed line ends": mixed_line_ends,
    "line ends of the other system": lambda text: text.replace(b"\n", b"\r\n"),
    "a long line": lambda text: text + b"\n" + record(
        SHELF, [CONTAINER, ("cn", "shelf"), ("description", "x" * 300000)]),
    "a value folded many times": lambda text: text + b"\n" + record(
        SHELF, [CONTAINER, ("cn", "shelf")]) + b"description: x" + b"\n x" * 5000 + b"\n",
    "many blank lines": lambda text: text.replace(b"\n\n", b"\n\n\n\n") + b"\n\n\n",
    "no version line": lambda text: text.removeprefix(b"version: 1\n"),
}


@pytest.mark.parametrize("kind", ACCEPTED)
def test_file_is_served_and_kept_with(instance, kind):
    text = ACCEPTED[kind](instance.config.read())
    instance.config.replace(text)
    expected = clients.parse_ldif(text.removeprefix(b"\xef\xbb\xbf"))
    instance.start()
    assert clients.search(clients.bind(instance)) == expected
    instance.stop()
    assert instance.config.read() == text


def test_configuration_given_as_a_symbolic_link_is_served(instance, tmp_path):
    target = tmp_path / "elsewhere.ldif"
    instance.config.path.rename(target)
    instance.config.path.symlink_to(target)
    instance.start()
    client = clients.bind(instance)
    assert search_code(client) == 0
    assert instance.config.path.is_symlink()
    # Changes go to the target, and the file before them stands beside it.
    before = target.read_bytes()
    client.modify_s(clients.BASE, [(ldap.MOD_REPLACE, "description", [b"changed"])])
    assert instance.config.path.is_symlink()
    assert target.read_bytes() != before
    assert (tmp_path / "elsewhere.ldif.save").read_bytes() == before
    assert not (instance.config.path.parent / (instance.config.path.name + ".save")).exists()
