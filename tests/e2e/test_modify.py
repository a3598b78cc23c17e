"""Settings are modified over LDAP: which lists of modifications are taken, what the file holds
afterwards, and when the running server goes by it."""

import random

import ldap
import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import (GROUP, LOGS, PASSWORD, add, added, container, deleted, member,
                             modify, refusal, replaced)

NEW_PASSWORD = "Qm4&wt8?Lb6%"
TOP = "cn=configuration"


def values_of(client, dn, name):
    return clients.read(client, dn, [name]).get(name, [])


@pytest.fixture(name="place")
def place_fixture(root):
    dn, attributes = container("to be changed")
    assert add(root, dn, attributes) == 0
    return dn


# ---- what a user sees

def test_setting_changed_with_ldapmodify_is_one_line_in_the_file(server, tmp_path):
    before = server.config.read()
    file = tmp_path / "change.ldif"
    file.write_text("dn: cn=configuration\nchangetype: modify\nreplace: orv-slapdSizeLimit\n"
                    "orv-slapdSizeLimit: 500\n-\n")
    done = clients.command("ldapmodify", server, "-f", str(file))
    assert done.returncode == 0, done.stderr
    removed, put_in = changes.difference(before, server.config.read())
    assert removed == [b"orv-slapdSizeLimit: 0"]
    assert put_in == [b"orv-slapdSizeLimit: 500"]


def test_limit_is_in_force_with_the_next_operation(root):
    entries = len(clients.search(root))
    assert entries > 2
    assert modify(root, TOP, replaced("orv-slapdSizeLimit", "2")) == 0
    with pytest.raises(ldap.SIZELIMIT_EXCEEDED):
        clients.search(root)
    assert modify(root, TOP, deleted("orv-slapdSizeLimit")) == 0
    assert len(clients.search(root)) == entries


def test_log_file_is_in_use_when_its_change_was_answered(server, root):
    path = server.directory / "moved.log"
    assert modify(root, "cn=access," + LOGS, replaced("orv-slapdLog", str(path)),
                  replaced("orv-slapdLogLevel", "info")) == 0
    assert path.exists()


def test_server_tells_which_settings_need_a_restart(server, root):
    shown = clients.search(root, "", ldap.SCOPE_BASE, attributes=["orv-restartSettings"])[""]
    assert set(shown["orv-restartSettings"]) == {
        b"orv-slapdPort", b"orv-slapdIpAddress", b"orv-slapdSecurePort", b"orv-slapdLocalSocket"}
    port = server.url
    assert modify(root, TOP, replaced("orv-slapdPort", "0")) == 0
    assert server.url == port
    assert clients.search(root)


def test_value_with_which_the_server_would_not_start_is_refused(server, root):
    before = server.config.read()
    code, text = refusal(root, TOP, replaced("orv-slapdMaxConnections", "0"))
    assert code == 19
    assert "orv-slapdMaxConnections" in text
    assert modify(root, "cn=default," + LOGS, replaced("orv-slapdLogLevel", "loud")) == 19
    assert server.config.read() == before


# ---- who is bound

def test_member_that_changes_its_own_password_hears_of_it_before_it_is_disconnected(server, root):
    assert add(root, *member("carol")) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    other = clients.bind(server, "cn=carol", PASSWORD)
    assert modify(carol, "cn=carol," + GROUP, replaced("orv-slapdAdminPW", NEW_PASSWORD)) == 0
    with pytest.raises(ldap.LDAPError):
        clients.search(other)
    assert clients.bind_code(server, "cn=carol", PASSWORD) == 49
    assert clients.bind_code(server, "cn=carol", NEW_PASSWORD) == 0


def test_member_that_loses_a_role_is_disconnected(server, root):
    assert add(root, *member("carol", roles=["AuditAdmin", "SchemaAdmin"])) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert clients.search(carol)
    assert modify(root, "cn=carol," + GROUP, deleted("orv-slapdAdminRole", "AuditAdmin")) == 0
    with pytest.raises(ldap.LDAPError):
        clients.search(carol)


def test_members_are_disconnected_when_the_group_is_switched_off(server, root):
    assert add(root, *member("carol")) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert modify(root, TOP, replaced("orv-slapdAdminGroupEnabled", "FALSE")) == 0
    with pytest.raises(ldap.LDAPError):
        clients.search(carol)
    assert clients.bind_code(server, "cn=carol", PASSWORD) == 49


def test_member_may_not_send_more_than_the_one_modification_of_its_password(server, root):
    assert add(root, *member("carol")) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    before = server.config.read()
    assert modify(carol, "cn=carol," + GROUP, deleted("orv-slapdAdminPW", PASSWORD),
                  added("orv-slapdAdminPW", NEW_PASSWORD)) == 50
    assert server.config.read() == before


def test_answer_does_not_tell_whether_a_guessed_password_is_right(server, root):
    assert add(root, *member("carol", roles=["NoAdmin"])) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert add(root, *member("dave", password=NEW_PASSWORD)) == 0
    for dn in (TOP, "cn=dave," + GROUP):
        for guess in (NEW_PASSWORD, server.password, "wrong guess"):
            assert modify(carol, dn, deleted("orv-slapdAdminPW", guess)) == 50, dn
            assert modify(carol, dn, deleted("orv-slapdAdminPW", guess),
                          added("orv-slapdAdminPW", "another guess")) == 50, dn
            assert modify(carol, dn, added("orv-slapdAdminPW", guess)) in (19, 50), dn
        codes = {modify(carol, dn, added("orv-slapdAdminPW", guess))
                 for guess in (NEW_PASSWORD, server.password, "wrong guess")}
        assert len(codes) == 1, dn


# ---- lists

def test_list_that_cannot_be_folded_is_refused_and_leaves_every_byte(server, root, place):
    before = server.config.read()
    code, text = refusal(root, place, added("description", "a"), replaced("description", "b"))
    assert code == 53
    assert "description" in text
    assert server.config.read() == before


def test_two_replaces_of_one_type_end_as_the_second(root, place):
    assert modify(root, place, replaced("description", "a", "b"), replaced("description", "c")) == 0
    assert values_of(root, place, "description") == [b"c"]


def test_second_value_cannot_be_brought_past_a_rule(server, root):
    before = server.config.read()
    assert modify(root, TOP, replaced("orv-slapdIpAddress", "192.0.2.1"),
                  added("orv-slapdIpAddress", "127.0.0.1")) == 19
    assert modify(root, TOP, added("orv-slapdAdminDN", "cn=second")) == 19
    assert server.config.read() == before


def test_classes_and_the_name_of_an_entry_stay(server, root, place):
    before = server.config.read()
    assert modify(root, place, added("objectClass", "orv-slapdSupplier")) == 69
    assert modify(root, place, replaced("objectClass", "top", "container")) == 69
    assert modify(root, place, deleted("objectClass", "container")) == 69
    assert modify(root, place, deleted("cn", "To  Be Changed")) == 67
    assert modify(root, place, added("objectClass", "orv-slapdAdminGroupSettings")) == 53
    assert server.config.read() == before


# A model of an entry under RFC 4511, 4.6: types to sets of values that ignore letter case.

def applied(model, modifications):
    """The model after a list of modifications, or None when one of them fails."""
    state = {name: set(values) for name, values in model.items()}
    for operation, name, values in modifications:
        held = state.setdefault(name, set())
        given = [value.lower() for value in values or []]
        if operation == ldap.MOD_REPLACE:
            held.clear()
        if operation == ldap.MOD_DELETE:
            if not held or not set(given) <= held:
                return None
            held.difference_update(given or set(held))
            continue
        if set(given) & held or len(set(given)) < len(given):
            return None
        held.update(given)
    return state


def random_list(source):
    modifications = []
    for _ in range(source.randint(1, 4)):
        operation = source.choice([ldap.MOD_ADD, ldap.MOD_DELETE, ldap.MOD_REPLACE])
        least = 1 if operation == ldap.MOD_ADD else 0
        values = source.sample(["a", "B", "c", "d"], source.randint(least, 2))
        modifications.append((operation, "description", values or None))
    return modifications


def forgets_that_nothing_was_there(model, modifications):
    first = modifications[0]
    return (len(modifications) > 1 and first[0] == ldap.MOD_DELETE and not first[2]
            and not model.get("description"))


def test_random_lists_end_as_the_client_ordered_or_change_nothing(server, root, place):
    source = random.Random(20260101)
    model = {"description": set()}
    taken = 0
    for _ in range(300):
        modifications = random_list(source)
        before = server.config.read()
        code = modify(root, place, *modifications)
        if code != 0:
            assert server.config.read() == before
            if applied(model, modifications) is not None:
                assert code == 53, modifications
            continue
        taken += 1
        if forgets_that_nothing_was_there(model, modifications):
            model = {"description": {"something"}}
        model = applied(model, modifications)
        assert model is not None, modifications
        stored = {value.decode().lower() for value in values_of(root, place, "description")}
        assert stored == model["description"], modifications
    assert taken > 50
