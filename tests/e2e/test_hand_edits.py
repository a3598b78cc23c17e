"""A file that somebody edited by hand: the server serves it and says at the start what is doubtful."""

import subprocess

import ldap
import pytest

from orv_e2e import changes, clients, programs
from orv_e2e.changes import add, delete

PASS_THROUGH = "cn=partner,cn=passthrough authentication,cn=configuration"


def said_at_start(instance, *options):
    """What a server writes to standard error until it is ready."""
    instance.start(*options)
    instance.stop()
    return instance.stderr.text()


def checked(instance, *options):
    done = subprocess.run([*instance.command(*options), "--check"], stdout=subprocess.PIPE,
                          stderr=subprocess.STDOUT, timeout=programs.DEADLINE, check=False)
    return done.returncode, done.stdout.decode()


def second_value(config):
    config.set(clients.BASE, "orv-slapdPwEncryption", "AES256", "SHA")


def unknown_class(config):
    config.add("cn=odd,cn=configuration", [("objectClass", ["top", "container", "noSuchClass"]),
                                           ("cn", "odd")])


def type_by_number(config):
    config.add("cn=odd,cn=configuration", [("objectClass", ["top", "container"]),
                                           ("2.5.4.3", "odd")])


def pass_through_without_subtree(config):
    config.add(PASS_THROUGH, [("objectClass", ["top", "orv-slapdConfigEntry", "orv-slapdPta"]),
                              ("cn", "partner"), ("orv-slapdPtaURL", "ldap://127.0.0.1")])


def identity_inside(config):
    config.add_member("inside", "in the open", bind_dn="cn=digest,cn=configuration")


def stale_address(config):
    config.set(clients.BASE, "orv-slapdIpAddress", "127.0.0.1", "192.0.2.1")


DOUBTS = [
    (second_value, "orv-slapdPwEncryption"), (unknown_class, "noSuchClass"),
    (type_by_number, "2.5.4.3 stands under its number"),
    (pass_through_without_subtree, "orv-slapdPtaSubtree"),
    (identity_inside, "lies inside the configuration"),
    (stale_address, "192.0.2.1 is no address of this host"),
]


@pytest.mark.parametrize("edit, text", DOUBTS)
def test_start_and_check_tell_of(instance, edit, text):
    assert text not in said_at_start(instance, "--address", "127.0.0.1")
    edit(instance.config)
    assert text in said_at_start(instance, "--address", "127.0.0.1")
    code, told = checked(instance)
    assert code == 0 and text in told


def test_key_that_opens_none_of_the_passwords_is_told_at_start(instance, tmp_path):
    other = type(instance).create(tmp_path / "other")
    instance.key_stash = other.key_stash
    assert "does not open with the key of the stash file" in said_at_start(instance)


def test_untouched_default_file_raises_no_doubt(instance):
    _, told = checked(instance)
    assert [line for line in told.splitlines() if "warning" in line or "error" in line] == []


def test_dn_of_two_identities_binds_as_neither_and_is_told_once(instance):
    instance.config.add_member("one", changes.PASSWORD, bind_dn="cn=twin")
    instance.config.add_member("two", changes.PASSWORD, bind_dn="CN = Twin")
    instance.start()
    for _ in range(3):
        client = clients.connect(instance)
        with pytest.raises(ldap.INVALID_CREDENTIALS):
            client.simple_bind_s("cn=twin", changes.PASSWORD)
        client.unbind_s()
    instance.stop()
    lines = [line for line in instance.stderr.lines() if "nobody can bind as" in line]
    assert len(lines) == 1 and " error " in lines[0], lines


def test_second_bind_dn_of_an_entry_is_nobodys(instance):
    instance.config.add_member("carol", changes.PASSWORD)
    instance.config.set("cn=carol," + changes.GROUP, "orv-slapdAdminDN", "cn=carol", "cn=shadow")
    instance.start()
    clients.bind(instance, "cn=carol", changes.PASSWORD).unbind_s()
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        clients.bind(instance, "cn=shadow", changes.PASSWORD)


def test_replication_entry_elsewhere_defines_no_supplier(instance):
    dn, attributes = changes.supplier("elsewhere", bind_dn="cn=elsewhere",
                                      kind="orv-slapdReplication")
    instance.config.add(dn, list(attributes.items()))
    instance.start()
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        clients.bind(instance, "cn=elsewhere", changes.PASSWORD)


def test_change_keeps_every_byte_that_somebody_wrote(instance):
    text = instance.config.read()
    text += (b"\n# a comment of mine\ndn:  CN = Mine ,cn=Schemas,  CN=CONFIGURATION\n"
             b"OBJECTCLASS: top\nobjectclass:   container\n# inside\ncommonName: Mi\n ne\n"
             b"description:: b25l\n\n\n# the end")
    instance.config.replace(text)
    instance.start()
    root = clients.bind(instance)
    dn, attributes = changes.container("added")
    assert add(root, dn, attributes) == 0
    removed, added = changes.difference(text, instance.config.read())
    assert removed == []
    assert [line for line in added if line] == [b"dn: " + dn.encode(), b"objectClass: top",
                                                b"objectClass: container", b"cn: added"]
    assert delete(root, dn) == 0
    assert instance.config.read() == text
    assert delete(root, "cn=mine,cn=schemas,cn=configuration") == 0
    root.unbind_s()


def test_edit_during_the_work_is_seen_and_never_overwritten(server, root):
    server.config.add("cn=edited," + changes.PLACE, [("objectClass", ["top", "container"]),
                                                     ("cn", "edited")])
    assert add(root, *changes.container("added")) == 0
    assert clients.names(root, "(|(cn=edited)(cn=added))") == {
        "cn=edited," + changes.PLACE, "cn=added," + changes.PLACE}


def test_damaged_file_refuses_changes_and_the_mended_one_takes_them(server, root):
    good = server.config.read()
    server.config.replace(good + b"\nnonsense\n")
    assert add(root, *changes.container("added")) != 0
    assert delete(root, "cn=digest,cn=configuration") != 0
    assert server.config.read() == good + b"\nnonsense\n"
    server.config.replace(good)
    assert add(root, *changes.container("added")) == 0
    assert delete(root, "cn=digest,cn=configuration") == 0
