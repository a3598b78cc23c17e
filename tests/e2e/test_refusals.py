"""What the server does not offer, and how it says so."""

import ldap
import ldap.controls
import ldap.modlist
import pytest

from orv_e2e import clients, wire

ENTRY = "cn=new,cn=schemas,cn=configuration"
ATTRIBUTES = [("objectClass", [b"top", b"container"]), ("cn", [b"new"])]
CHANGE = [(ldap.MOD_REPLACE, "orv-slapdSizeLimit", [b"7"])]


@pytest.fixture(scope="module", name="shared")
def shared_fixture(module_instance):
    module_instance.config.add_member("alice", "alices password", ["ServerConfigGroupMember"])
    return module_instance.start()


@pytest.fixture(name="admin")
def admin_fixture(shared):
    client = clients.bind(shared)
    yield client
    client.unbind_s()


@pytest.fixture(name="stranger")
def stranger_fixture(shared):
    client = clients.connect(shared)
    yield client
    client.unbind_s()


OPERATIONS = {
    "add": lambda client: client.add_s(ENTRY, ATTRIBUTES),
    "delete": lambda client: client.delete_s("cn=digest,cn=configuration"),
    "modify": lambda client: client.modify_s(clients.BASE, CHANGE),
}


@pytest.mark.parametrize("operation", OPERATIONS)
def test_change_by_the_anonymous_is_refused_with_50(shared, stranger, operation):
    before = shared.config.read()
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        OPERATIONS[operation](stranger)
    assert shared.config.read() == before


def test_compare_is_refused_with_53(admin):
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        admin.compare_s(clients.BASE, "orv-slapdPort", b"3389")


def test_compare_with_a_password_is_refused_before_anything(admin, shared):
    for guess in (shared.password.encode(), b"wrong"):
        with pytest.raises(ldap.UNWILLING_TO_PERFORM):
            admin.compare_s(clients.BASE, "orv-slapdAdminPW", guess)


def test_rename_is_refused_with_53(admin):
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        admin.rename_s("cn=digest,cn=configuration", "cn=other")


def control(critical):
    return ldap.controls.RequestControl("1.2.3.4.5.6", critical, b"value")


def test_unknown_critical_control_is_refused_with_12(admin):
    with pytest.raises(ldap.UNAVAILABLE_CRITICAL_EXTENSION):
        admin.search_ext_s(clients.BASE, ldap.SCOPE_BASE, serverctrls=[control(True)])
    assert clients.read(admin, clients.BASE)


def test_unknown_critical_control_on_a_bind_is_refused_with_12(shared, stranger):
    with pytest.raises(ldap.UNAVAILABLE_CRITICAL_EXTENSION):
        stranger.simple_bind_s("cn=root", shared.password, serverctrls=[control(True)])
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.read(stranger, clients.BASE)


def test_unknown_control_that_is_not_critical_is_ignored(admin):
    found = admin.search_ext_s(clients.BASE, ldap.SCOPE_BASE, serverctrls=[control(False)])
    assert len(found) == 1


def test_unknown_extended_operation_is_refused_with_2(admin):
    request = ldap.extop.ExtendedRequest("1.2.3.4.5.6", b"value")
    with pytest.raises(ldap.PROTOCOL_ERROR):
        admin.extop_s(request)
    assert clients.read(admin, clients.BASE)


def test_refused_operations_are_not_announced(stranger):
    root_dse = stranger.search_s("", ldap.SCOPE_BASE, attrlist=["*", "+"])[0][1]
    assert b"1.3.6.1.4.1.4203.1.11.1" not in root_dse["supportedExtension"]


def test_answers_keep_the_message_numbers(shared):
    with wire.Wire(shared) as connection:
        assert connection.bind("cn=root", shared.password, 0x7FFFFFFF) == 0
        assert connection.search(0x7FFFFFFE) == (0, 1)
