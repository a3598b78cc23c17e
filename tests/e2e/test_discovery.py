"""What a client learns about the server without knowing it: root DSE and subschema."""

import re

import ldap
import ldap.schema
import pytest

from orv_e2e import clients

MANAGE_DSA_IT = b"2.16.840.1.113730.3.4.2"


@pytest.fixture(scope="module", name="shared")
def shared_fixture(module_instance):
    return module_instance.start()


@pytest.fixture(scope="module", name="client")
def client_fixture(shared):
    client = clients.connect(shared)
    yield client
    client.unbind_s()


def root_dse(client, attributes=("*", "+")):
    (dn, attributes), = client.search_s("", ldap.SCOPE_BASE, attrlist=list(attributes))
    assert dn == ""
    return attributes


def test_root_dse_is_readable_before_a_bind(client):
    assert root_dse(client)["supportedLDAPVersion"] == [b"3"]


def test_root_dse_names_the_configuration_as_naming_context(client):
    assert [value.upper() for value in root_dse(client)["namingContexts"]] == [
        b"CN=CONFIGURATION"]


def test_root_dse_names_the_control_that_the_backend_registered(client):
    assert root_dse(client)["supportedControl"][0] == MANAGE_DSA_IT


def test_root_dse_names_the_vendor(client):
    entry = root_dse(client)
    assert entry["vendorName"] and entry["vendorVersion"]


def test_operational_attributes_of_the_root_dse_come_only_when_asked_for(client):
    assert "namingContexts" not in root_dse(client, ["*"])
    assert "namingContexts" in root_dse(client, ["+"])
    assert set(root_dse(client, ["NAMINGCONTEXTS"])) == {"namingContexts"}


def test_root_dse_heeds_the_filter(client):
    assert client.search_s("", ldap.SCOPE_BASE, "(objectClass=person)") == []


def test_ldapsearch_without_options_for_the_root_dse(shared):
    found = clients.command("ldapsearch", shared, "-LLL", "-s", "base", "-b", "", "+", who=None)
    assert found.returncode == 0
    assert b"subschemaSubentry:" in found.stdout


@pytest.fixture(scope="module", name="schema")
def schema_fixture(shared):
    """The schema as python3-ldap reads it, by way of the root DSE."""
    dn, schema = ldap.schema.urlfetch(shared.url)
    assert dn
    return schema


def test_every_schema_description_can_be_read_by_a_client(schema):
    for kind in (ldap.schema.ObjectClass, ldap.schema.AttributeType):
        elements = list(schema.listall(kind))
        assert len(elements) > 10
        for oid in elements:
            assert schema.get_obj(kind, oid).names


def test_schema_says_what_an_entry_of_the_top_needs(schema):
    top = schema.get_obj(ldap.schema.ObjectClass, "orv-slapdTop")
    assert "orv-slapdAdminDN" in top.must
    assert "orv-slapdAdminPW" in top.may


def test_schema_makes_the_role_of_a_member_mandatory(schema):
    member = schema.get_obj(ldap.schema.ObjectClass, "orv-slapdAdminGroupMember")
    assert {"orv-slapdAdminDN", "orv-slapdAdminRole"} <= set(member.must)


@pytest.mark.parametrize("name", ["orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdKrbAdminDN",
                                  "orv-slapdDigestAdminUser", "orv-slapdMasterDN",
                                  "orv-slapdMasterPW", "orv-slapdLog", "orv-slapdPwEncryption",
                                  "orv-slapdProxySplitName", "orv-slapdPtaURL"])
def test_attributes_of_which_rules_see_the_first_value_are_single_valued(schema, name):
    assert schema.get_obj(ldap.schema.AttributeType, name).single_value


def test_schema_explains_every_entry_of_the_default_configuration(shared, schema):
    for dn, entry in clients.search(clients.bind(shared)).items():
        classes = [value.decode() for value in entry["objectClass"]]
        must, may = schema.attribute_types(classes, raise_keyerror=1)
        allowed = {name.lower() for kind in (must, may) for oid in kind
                   for name in schema.get_obj(ldap.schema.AttributeType, oid).names}
        unexplained = {name for name in entry if name.lower() not in allowed}
        assert not unexplained, dn


def test_object_identifiers_of_our_own_lie_under_one_arc(schema):
    for kind in (ldap.schema.ObjectClass, ldap.schema.AttributeType):
        for oid in schema.listall(kind):
            if schema.get_obj(kind, oid).names[0].startswith("orv-"):
                assert re.fullmatch(r"2\.25\.\d+(\.\d+)*", oid), oid


def test_subschema_entry_is_a_base_search_of_its_own(client):
    dn = root_dse(client)["subschemaSubentry"][0].decode()
    (found, attributes), = client.search_s(dn, ldap.SCOPE_BASE, "(objectClass=subschema)",
                                           ["objectClasses", "attributeTypes"])
    assert clients.dn_key(found) == clients.dn_key(dn)
    assert set(attributes) == {"objectClasses", "attributeTypes"}
