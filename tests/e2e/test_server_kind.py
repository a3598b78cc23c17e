"""A server of kind 3 shows its configuration to callers with a mark that LDAP does not carry."""

import ldap
import pytest

from orv_e2e import clients


@pytest.fixture(name="kind_3")
def kind_3_fixture(instance):
    instance.config.add_member("auditor", "auditorpassword", roles=("AuditAdmin",))
    return instance.start("--server-type", "3")


def code_of_search(client, scope):
    return clients.code_of(clients.search, client, scope=scope)


@pytest.mark.parametrize("scope", [ldap.SCOPE_BASE, ldap.SCOPE_ONELEVEL, ldap.SCOPE_SUBTREE])
def test_search_is_answered_32_for_every_administrator(kind_3, scope):
    assert code_of_search(clients.bind(kind_3), scope) == 32
    assert code_of_search(clients.bind(kind_3, "cn=auditor", "auditorpassword"), scope) == 32


def test_search_of_strangers_is_answered_32_too(kind_3):
    assert code_of_search(clients.connect(kind_3), ldap.SCOPE_SUBTREE) == 32


def test_server_itself_is_found_by_everybody(kind_3):
    assert clients.connect(kind_3).search_s("", ldap.SCOPE_BASE)


@pytest.mark.parametrize("kind", ["0", "1", "2", "4"])
def test_other_kinds_show_it(instance, kind):
    instance.start("--server-type", kind)
    assert code_of_search(clients.bind(instance), ldap.SCOPE_SUBTREE) == 0


@pytest.mark.parametrize("kind, announced", [("0", True), ("1", True), ("3", False)])
def test_control_of_references_is_announced_on_other_kinds_only(instance, kind, announced):
    client = clients.connect(instance.start("--server-type", kind))
    [(_, root_dse)] = client.search_s("", ldap.SCOPE_BASE, attrlist=["supportedControl"])
    assert (b"2.16.840.1.113730.3.4.2" in root_dse.get("supportedControl", [])) == announced
