"""What each identity sees of the credentials in the configuration."""

import ldap
import pytest

from orv_e2e import clients

GROUP = "cn=admingroup,cn=configuration"
ALICE = "cn=alice," + GROUP
BOB = "cn=bob," + GROUP
HIDDEN = {"orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdAdminGroupEnabled"}


@pytest.fixture(scope="module", name="people")
def people_fixture(module_instance):
    module_instance.config.add_member("alice", "alices password", ["ServerConfigGroupMember"])
    module_instance.config.add_member("bob", "bobs password", ["SchemaAdmin"])
    module_instance.config.add(
        "cn=nested," + BOB,
        [("objectClass", ["top", "orv-slapdConfigEntry"]), ("cn", "nested")])
    return module_instance.start()


@pytest.fixture(name="alice")
def alice_fixture(people):
    client = clients.bind(people, "CN=Alice", "alices password")
    yield client
    client.unbind_s()


@pytest.fixture(name="admin")
def admin_fixture(people):
    client = clients.bind(people)
    yield client
    client.unbind_s()


def file_entries(instance):
    return clients.parse_ldif(instance.config.read())


def test_ldapsearch_by_the_administrator_shows_the_whole_file(people):
    found = clients.command("ldapsearch", people, "-LLL", "-b", "cn=configuration")
    assert found.returncode == 0, found.stderr
    assert clients.parse_ldif(found.stdout) == file_entries(people)


def test_administrator_sees_its_credentials(admin):
    assert HIDDEN <= set(clients.read(admin, clients.BASE))


def test_administrator_sees_every_members_password(admin):
    assert clients.read(admin, ALICE)["orv-slapdAdminPW"] == [b"alices password"]
    assert clients.read(admin, BOB)["orv-slapdAdminPW"] == [b"bobs password"]


def test_password_of_the_administrator_is_shown_sealed(admin, people):
    value, = clients.read(admin, clients.BASE)["orv-slapdAdminPW"]
    assert value.startswith(b"{AES256}")
    assert people.password.encode() not in value


def test_member_sees_the_tree_without_credentials_but_its_own(alice, people):
    expected = file_entries(people)
    for name in HIDDEN:
        expected[clients.BASE].pop(name)
    expected[BOB].pop("orv-slapdAdminPW")
    assert clients.search(alice) == expected


@pytest.mark.parametrize("attributes", [None, ["*"], ["*", "+"], sorted(HIDDEN),
                                        ["ORV-SLAPDADMINPW", "orv-slapdadmindn"]])
def test_no_selection_shows_a_member_the_administrators_credentials(alice, attributes):
    found = {name.lower() for name in clients.read(alice, clients.BASE, attributes)}
    assert not found & {name.lower() for name in HIDDEN}


def test_member_sees_its_own_password(alice):
    assert clients.read(alice, ALICE, ["orv-slapdAdminPW"]) == {
        "orv-slapdAdminPW": [b"alices password"]}


def test_member_sees_the_rest_of_another_members_entry(alice):
    entry = clients.read(alice, BOB)
    assert entry["orv-slapdAdminDN"] == [b"cn=bob"]
    assert "orv-slapdAdminPW" not in entry


def test_entry_with_nothing_but_anothers_password_is_not_sent(alice):
    found = clients.search(alice, GROUP, attributes=["orv-slapdAdminPW"])
    assert BOB not in found
    assert found[ALICE] == {"orv-slapdAdminPW": [b"alices password"]}


def test_types_only_search_names_no_password_of_another_member(alice):
    found = clients.search(alice, types_only=1)
    assert "orv-slapdAdminPW" not in found[BOB]
    assert "orv-slapdAdminRole" in found[BOB]
    assert not HIDDEN & set(found[clients.BASE])


def test_group_container_is_shown_to_members(alice):
    assert clients.read(alice, GROUP)["objectClass"]


def test_member_reads_the_group_one_level_without_passwords_of_others(alice):
    found = clients.search(alice, GROUP, ldap.SCOPE_ONELEVEL)
    assert set(found) == {ALICE, BOB}
    assert "orv-slapdAdminPW" in found[ALICE]
    assert "orv-slapdAdminPW" not in found[BOB]


@pytest.mark.parametrize("filter_text", [
    "(orv-slapdAdminPW=bobs password)", "(orv-slapdAdminPW=b*)", "(orv-slapdAdminPW=*password)",
    "(orv-slapdAdminPW>=a)", "(orv-slapdAdminPW<=z)", "(orv-slapdAdminPW~=bobs password)",
    "(orv-slapdAdminPW:caseExactMatch:=bobs password)",
    "(orv-slapdAdminPW:2.5.13.17:=bobs password)", "(orv-slapdAdminPW:dn:=bobs password)",
    "(!(orv-slapdAdminPW=bobs password))", "(!(orv-slapdAdminPW=another))",
    "(!(orv-slapdAdminPW>=zzzz))", "(!(orv-slapdAdminPW=x*))", "(ORV-SLAPDADMINPW=bobs password)",
    "(&(objectClass=*)(orv-slapdAdminPW=bobs password))",
    "(!(|(cn=missing)(orv-slapdAdminPW=another)))"])
@pytest.mark.parametrize("who", ["alice", "admin"])
def test_filter_is_no_oracle_for_a_password(request, who, filter_text):
    assert clients.names(request.getfixturevalue(who), filter_text, GROUP) == set()


def test_filter_without_an_attribute_name_is_no_oracle_for_a_password(admin):
    assert clients.names(admin, "(:caseExactMatch:=bobs password)") == set()


def test_presence_of_a_password_may_be_asked(admin, alice):
    for client in (admin, alice):
        found = clients.names(client, "(orv-slapdAdminPW=*)")
        assert {ALICE, BOB, clients.BASE} <= found


@pytest.mark.parametrize("filter_text", [
    "(orv-slapdAdminDN=cn=root)", "(orv-slapdAdminDN=CN=ROOT)", "(!(orv-slapdAdminDN=cn=other))",
    "(orv-slapdAdminDN>=a)", "(orv-slapdAdminDN=cn=r*)", "(orv-slapdAdminDN:=cn=root)",
    "(orv-slapdAdminGroupEnabled=TRUE)", "(!(orv-slapdAdminGroupEnabled=FALSE))",
    "(orv-slapdAdminGroupEnabled=T*)"])
def test_filter_is_no_oracle_for_what_a_member_may_not_see(alice, filter_text):
    assert clients.BASE not in clients.names(alice, filter_text)


def test_administrator_may_ask_for_its_own_name(admin):
    assert clients.names(admin, "(orv-slapdAdminDN=CN = Root)") == {clients.BASE}


def test_sizes_of_answers_are_the_same_whatever_is_hidden(alice):
    everything = clients.search(alice)
    assert set(everything) == set(clients.search(alice, attributes=["1.1"]))
