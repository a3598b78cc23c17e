"""Clients that are told of changes as they happen."""

import ldap
import ldap.filter
import pytest
from ldap.controls import RequestControl

from orv_e2e import clients
from orv_e2e.config_file import dn_key
from orv_e2e.persistent import ADD, DELETE, Listener
from orv_e2e.programs import DEADLINE

GROUP = "cn=admingroup,cn=configuration"
CLASSES = [b"top", b"orv-slapdConfigEntry", b"orv-slapdAdminGroupMember"]
PASSWORD = b"Vx7#kq9!Zp3$"


def member_dn(name):
    return "cn=%s,%s" % (name, GROUP)


def add_member(client, name, roles=(b"SchemaAdmin",)):
    client.add_s(member_dn(name), [
        ("objectClass", CLASSES), ("cn", name.encode()),
        ("orv-slapdAdminDN", b"cn=" + name.encode()), ("orv-slapdAdminPW", PASSWORD),
        ("orv-slapdAdminRole", list(roles))])


def bind_member(server, name):
    return clients.bind(server, "cn=" + name, PASSWORD.decode())


def test_the_root_dse_offers_it(server):
    dse = clients.read(clients.connect(server), "", ["supportedControl"])
    for oid in (b"2.16.840.1.113730.3.4.3", b"2.16.840.1.113730.3.4.7",
                b"2.16.840.1.113730.3.4.2"):
        assert oid in dse["supportedControl"]


def test_an_added_entry_is_told_with_its_type_of_change(server, root):
    listener = Listener(clients.bind(server)).established()
    add_member(root, "alice")
    dn, attributes, change = listener.next()
    assert (dn, change) == (dn_key(member_dn("alice")), ADD)
    assert attributes["orv-slapdAdminDN"] == [b"cn=alice"]


def test_a_deleted_entry_is_told_as_it_was(server, root):
    add_member(root, "alice")
    listener = Listener(clients.bind(server)).established()
    root.delete_s(member_dn("alice"))
    dn, attributes, change = listener.next()
    assert (dn, change) == (dn_key(member_dn("alice")), DELETE)
    assert attributes["orv-slapdAdminRole"] == [b"SchemaAdmin"]


def test_changes_come_in_their_order(server, root):
    listener = Listener(clients.bind(server), attributes=["1.1"]).established()
    expected = []
    for number in range(20):
        add_member(root, "m%d" % number)
        expected.append((dn_key(member_dn("m%d" % number)), ADD))
        if number % 2:
            root.delete_s(member_dn("m%d" % (number - 1)))
            expected.append((dn_key(member_dn("m%d" % (number - 1))), DELETE))
    # An entry that was deleted before its addition could be told is only told as deleted.
    told = []
    while not told or told[-1] != expected[-1]:
        dn, _, change = listener.next()
        told.append((dn, change))
    assert [each for each in expected if each in told] == told
    assert [each for each in told if each[1] == DELETE] == \
        [each for each in expected if each[1] == DELETE]


def test_first_come_the_entries_that_are_there(server, root):
    add_member(root, "alice")
    listener = Listener(clients.bind(server), GROUP, filter_text="(cn=a*)", changes_only=False)
    assert {listener.next()[0] for _ in range(2)} == \
        {dn_key(GROUP), dn_key(member_dn("alice"))}
    add_member(root, "anna")
    dn, _, change = listener.next()
    assert (dn, change) == (dn_key(member_dn("anna")), ADD)


def test_filter_scope_selection_and_types_hold_for_notices(server, root):
    add_member(root, "bob")
    listener = Listener(clients.bind(server), GROUP, ldap.SCOPE_ONELEVEL,
                        "(&(cn=*li*)(orv-slapdAdminRole=SCHEMAADMIN))", ["cn"],
                        types=("add", "delete")).established()
    only_added = Listener(clients.bind(server), GROUP, types=("add",),
                          notifications=False).established()
    root.delete_s(member_dn("bob"))
    add_member(root, "alice")
    add_member(root, "carla", (b"AuditAdmin",))
    root.delete_s(member_dn("carla"))
    root.delete_s(member_dn("alice"))
    first, last = listener.next(), listener.next()
    if first[2] == ADD:
        assert first == (dn_key(member_dn("alice")), {"cn": [b"alice"]}, ADD)
    assert last == (dn_key(member_dn("alice")), {"cn": [b"alice"]}, DELETE) or \
        first == (dn_key(member_dn("alice")), {"cn": [b"alice"]}, DELETE)
    dn, _, change = only_added.next()
    assert change is None


def test_credentials_are_hidden_as_in_a_search(server, root):
    add_member(root, "listener")
    as_member = Listener(bind_member(server, "listener")).established()
    as_root = Listener(clients.bind(server)).established()
    add_member(root, "alice")
    for listener, sees in ((as_member, False), (as_root, True)):
        dn, attributes, _ = listener.next()
        assert dn == dn_key(member_dn("alice"))
        assert ("orv-slapdAdminPW" in attributes) is sees
    root.delete_s(member_dn("alice"))
    for listener, sees in ((as_member, False), (as_root, True)):
        _, attributes, change = listener.next()
        assert change == DELETE
        assert ("orv-slapdAdminPW" in attributes) is sees


def test_a_filter_on_a_password_finds_nothing_in_what_was_deleted(server, root):
    add_member(root, "alice")
    stored = clients.read(root, member_dn("alice"), ["orv-slapdAdminPW"])["orv-slapdAdminPW"][0]
    listening = clients.bind(server)
    guess = Listener(listening, filter_text=ldap.filter.filter_format(
        "(orv-slapdAdminPW=%s)", [stored.decode()]))
    # Told after the other one.
    presence = Listener(listening, filter_text="(orv-slapdAdminPW=*)").established()
    root.delete_s(member_dn("alice"))
    assert presence.next()[2] == DELETE
    assert not guess.has_heard()


def test_strangers_may_not_listen(server):
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        Listener(clients.connect(server)).result()
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        Listener(clients.connect(server), changes_only=False).result()


def test_a_missing_base_is_told_at_once(server, root):
    with pytest.raises(ldap.NO_SUCH_OBJECT):
        Listener(root, "cn=nobody," + GROUP).result()


def test_who_loses_its_rights_hears_nothing_more(server, root):
    add_member(root, "listener")
    listener = Listener(bind_member(server, "listener")).established()
    root.delete_s(member_dn("listener"))
    add_member(root, "alice")
    with pytest.raises((ldap.SERVER_DOWN, ldap.UNAVAILABLE, ldap.STRONG_AUTH_REQUIRED)):
        while True:
            assert listener.next()[0] != dn_key(member_dn("alice"))


def test_an_abandoned_search_makes_room(server, root):
    root_client = clients.bind(server)
    listeners = [Listener(root_client) for _ in range(8)]
    with pytest.raises(ldap.ADMINLIMIT_EXCEEDED):
        Listener(root_client).result()
    listeners[0].abandon()
    last = Listener(root_client).established()
    add_member(root, "alice")
    assert last.next()[0] == dn_key(member_dn("alice"))


def test_searches_are_bounded_in_all(instance):
    instance.config.set("cn=configuration", "orv-slapdMaxPersistentSearches", "2")
    instance.start()
    first, second = (clients.bind(instance) for _ in range(2))
    Listener(first).established()
    Listener(second).established()
    third = clients.bind(instance)
    with pytest.raises(ldap.BUSY):
        Listener(third).result()
    first.unbind_s()
    while True:
        listener = Listener(third).established()
        try:
            listener.has_heard()
            break
        except ldap.BUSY:
            continue
    for client in (second, third):
        client.unbind_s()


def test_a_bind_ends_them(server, root):
    client = clients.bind(server)
    Listener(client).established()
    client.simple_bind_s(clients.ADMINISTRATOR, server.password)
    listener = Listener(client).established()
    add_member(root, "alice")
    assert listener.next()[0] == dn_key(member_dn("alice"))


def test_a_connection_that_listens_is_not_idle(instance):
    instance.config.set("cn=configuration", "orv-slapdIdleTimeOut", "1")
    instance.start()
    listening, silent = (clients.bind(instance) for _ in range(2))
    listener = Listener(listening).established()
    # The silent connection is closed for its silence; the listening one is as old.
    with pytest.raises((ldap.SERVER_DOWN, ldap.UNAVAILABLE)):
        silent.result(timeout=DEADLINE)
    busy = clients.bind(instance)
    add_member(busy, "alice")
    assert listener.next()[0] == dn_key(member_dn("alice"))


def test_malformed_controls_are_refused(server, root):
    oid = "2.16.840.1.113730.3.4.3"
    for value in (None, b"", b"\x30\x00", b"\x30\x09\x02\x01\x00\x01\x01\xff\x01\x01\xff",
                  b"\x30\x09\x02\x01\x10\x01\x01\xff\x01\x01\xff",
                  b"\x30\x09\x02\x01\x01\x01\x01\xff\x01\x01\xff\x00"):
        with pytest.raises(ldap.PROTOCOL_ERROR):
            root.search_ext_s("cn=configuration", ldap.SCOPE_BASE,
                              serverctrls=[RequestControl(oid, True, value)])


def test_it_is_a_control_of_searches_of_the_configuration(server, root):
    good = b"\x30\x09\x02\x01\x01\x01\x01\xff\x01\x01\xff"
    critical = RequestControl("2.16.840.1.113730.3.4.3", True, good)
    with pytest.raises(ldap.UNAVAILABLE_CRITICAL_EXTENSION):
        root.delete_ext_s(member_dn("alice"), serverctrls=[critical])
    with pytest.raises(ldap.UNAVAILABLE_CRITICAL_EXTENSION):
        root.search_ext_s("", ldap.SCOPE_BASE, serverctrls=[critical])
    with pytest.raises(ldap.UNAVAILABLE_CRITICAL_EXTENSION):
        root.search_ext_s("cn=configuration", ldap.SCOPE_BASE, serverctrls=[
            RequestControl("2.16.840.1.113730.3.4.7", True)])


def test_manage_dsa_it_is_accepted(server, root):
    control = RequestControl("2.16.840.1.113730.3.4.2", True)
    root.add_ext_s(member_dn("alice"), [
        ("objectClass", CLASSES), ("cn", b"alice"), ("orv-slapdAdminDN", b"cn=alice"),
        ("orv-slapdAdminPW", PASSWORD), ("orv-slapdAdminRole", b"SchemaAdmin")],
        serverctrls=[control])
    assert root.search_ext_s(member_dn("alice"), ldap.SCOPE_BASE, serverctrls=[control])
    root.delete_ext_s(member_dn("alice"), serverctrls=[control])


def test_the_server_stops_while_somebody_listens(server):
    client = clients.bind(server)
    Listener(client).established()
    server.stop()
