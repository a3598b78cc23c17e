"""Scopes, filters, selections, limits and spellings of a search."""

import ldap
import pytest

from orv_e2e import clients, wire
from orv_e2e.config_file import record

LOGS = "cn=log management,cn=configuration"
AUDIT = "cn=audit," + LOGS
SHELF = "cn=shelf,cn=schemas,cn=configuration"

BOOKS = {
    "one": ["first book", "about  Blanks"],
    "two": ["Second (book)", "100%", "star*star"],
    "three": ["third\\book", "umlaut Ä"],
    "four": [],
}


def book(name):
    return "cn=%s,%s" % (name, SHELF)


def books(*chosen):
    return {book(name) for name in chosen}


@pytest.fixture(scope="module", name="shelf")
def shelf_fixture(module_instance):
    """A running instance with entries of ours below CN=SCHEMAS."""
    text = record(SHELF, [("objectClass", ["top", "container"]), ("cn", "shelf")])
    for name, descriptions in BOOKS.items():
        text += b"\n" + record(book(name), [("objectClass", ["top", "container"]), ("cn", name),
                                            ("description", descriptions)])
    module_instance.config.append(text)
    return module_instance.start()


@pytest.fixture(scope="module", name="admin")
def admin_fixture(shelf):
    client = clients.bind(shelf)
    yield client
    client.unbind_s()


def test_base_search_gives_the_base_alone(admin):
    assert set(clients.search(admin, SHELF, ldap.SCOPE_BASE)) == {SHELF}


def test_one_level_search_gives_the_children_without_the_base(admin):
    assert set(clients.search(admin, SHELF, ldap.SCOPE_ONELEVEL)) == books(*BOOKS)
    assert book("one") not in clients.search(admin, "cn=schemas,cn=configuration",
                                             ldap.SCOPE_ONELEVEL)


def test_subtree_search_gives_the_base_and_all_below(admin):
    assert set(clients.search(admin, SHELF)) == books(*BOOKS) | {SHELF}


def test_subtree_search_gives_parents_before_children(admin):
    seen = set()
    for dn, _ in admin.search_s("cn=configuration", ldap.SCOPE_SUBTREE, "(objectClass=*)", ["1.1"]):
        key = clients.dn_key(dn)
        parent = key.partition(",")[2]
        assert parent in seen or key == clients.BASE
        seen.add(key)


def test_one_level_search_below_a_leaf_is_empty(admin):
    assert clients.search(admin, book("one"), ldap.SCOPE_ONELEVEL) == {}


@pytest.mark.parametrize("filter_text, expected", [
    ("(objectClass=*)", books(*BOOKS) | {SHELF}),
    ("(cn=one)", books("one")),
    ("(CN=ONE)", books("one")),
    ("(commonName=one)", books("one")),
    ("(2.5.4.3=one)", books("one")),
    ("(cn=\\6fne)", books("one")),
    ("(cn=o*)", books("one")),
    ("(cn=*e)", books("one", "three")),
    ("(cn=*r*e*)", books("three")),
    ("(cn=t*e)", books("three")),
    ("(cn=*)", books(*BOOKS) | {SHELF}),
    ("(description=*)", books("one", "two", "three")),
    ("(!(description=*))", books("four") | {SHELF}),
    ("(description=about blanks)", books("one")),
    ("(description=ABOUT   BLANKS)", books("one")),
    ("(description=Second \\28book\\29)", books("two")),
    ("(description=star\\2astar)", books("two")),
    ("(description=star*star)", books("two")),
    ("(description=star\\2a*)", books("two")),
    ("(description=third\\5cbook)", books("three")),
    ("(description=umlaut ä)", books("three")),
    ("(description=umlaut \\c3\\a4)", books("three")),
    ("(description~=FIRST book)", books("one")),
    ("(cn>=t)", books("two", "three")),
    ("(cn<=one)", books("one", "four")),
    ("(&(cn=one)(description=first book))", books("one")),
    ("(&(cn=one)(description=100%))", set()),
    ("(|(cn=one)(cn=two)(cn=missing))", books("one", "two")),
    ("(&(|(cn=one)(cn=two))(!(description=100%)))", books("one")),
    ("(!(cn=one))", books("two", "three", "four") | {SHELF}),
    ("(!(!(cn=one)))", books("one")),
    ("(cn:caseExactMatch:=one)", books("one")),
    ("(cn:caseExactMatch:=ONE)", set()),
    ("(cn:2.5.13.2:=ONE)", books("one")),
    ("(cn:=one)", books("one")),
    ("(objectClass=container)", books(*BOOKS) | {SHELF}),
    ("(objectClass=CONTAINER)", books(*BOOKS) | {SHELF}),
    ("(objectClass=2.5.6.0)", books(*BOOKS) | {SHELF}),
    ("(objectClass:objectIdentifierMatch:=2.5.6.0)", books(*BOOKS) | {SHELF}),
    ("(objectClass=person)", set()),
    ("(nosuchattribute=one)", set()),
    ("(nosuchattribute=*)", set()),
    ("(!(nosuchattribute=one))", set()),
    ("(|(nosuchattribute=one)(cn=one))", books("one")),
    ("(cn=)", set()),
])
def test_filter_selects(admin, filter_text, expected):
    assert clients.names(admin, filter_text, SHELF) == expected


@pytest.mark.parametrize("filter_text, found", [
    ("(orv-slapdPort>=500)", True), ("(orv-slapdPort<=500)", False),
    ("(orv-slapdPort=3389)", True), ("(orv-slapdPort>=3389)", True),
    ("(orv-slapdAdminGroupEnabled=true)", True), ("(orv-slapdPort=word)", False),
    ("(!(orv-slapdPort=word))", False)])
def test_filter_compares_by_the_syntax_of_the_attribute(admin, filter_text, found):
    expected = {clients.BASE} if found else set()
    assert clients.names(admin, filter_text, scope=ldap.SCOPE_BASE) == expected


@pytest.mark.parametrize("selection, expected", [
    (None, {"objectClass", "cn", "description"}),
    (["*"], {"objectClass", "cn", "description"}),
    (["1.1"], set()),
    (["cn"], {"cn"}),
    (["CN"], {"cn"}),
    (["2.5.4.3"], {"cn"}),
    (["commonname"], {"cn"}),
    (["oBJECTcLASS", "description"], {"objectClass", "description"}),
    (["cn", "cn", "CN"], {"cn"}),
    (["*", "cn"], {"objectClass", "cn", "description"}),
    (["1.1", "cn"], {"cn"}),
    (["+"], set()),
    (["nosuchattribute"], set()),
    (["nosuchattribute", "cn"], {"cn"}),
])
def test_selection_of_attributes(admin, selection, expected):
    entry = clients.read(admin, book("one"), selection)
    assert {name.lower() for name in entry} == {name.lower() for name in expected}
    assert all(entry.values())


def test_values_come_as_they_stand_in_the_file_and_in_its_order(admin):
    assert clients.read(admin, book("two"))["description"] == [
        value.encode() for value in BOOKS["two"]]


def test_types_only_search_names_the_types_without_values(admin):
    entry = clients.search(admin, book("one"), ldap.SCOPE_BASE, types_only=1)[book("one")]
    assert entry == {"objectClass": [], "cn": [], "description": []}


def test_types_only_search_heeds_the_selection(shelf):
    found = clients.command("ldapsearch", shelf, "-LLL", "-A", "-s", "base", "-b", book("one"),
                            "CN")
    assert [line.strip() for line in found.stdout.decode().splitlines()[1:] if line] == ["cn:"]


@pytest.mark.parametrize("base", [
    AUDIT, AUDIT.upper(), "cn = audit , cn = log management , cn = configuration",
    "cn=audit,cn=log  management,cn=configuration",
    "cn=\\61udit,cn=log management,cn=configuration",
    "2.5.4.3=audit,2.5.4.3=log management,2.5.4.3=configuration",
    "commonName=audit,CN=log management,commonname=configuration",
    "cn=#0c056175646974,cn=log management,cn=configuration",
    "cn=audit,cn=log\\20management,cn=configuration"])
def test_base_is_found_under_every_spelling(admin, base):
    found = admin.search_s(base, ldap.SCOPE_BASE)
    assert [clients.dn_key(dn) for dn, _ in found] == [AUDIT]


@pytest.mark.parametrize("base", ["cn=missing,cn=configuration", "cn=a,cn=missing,cn=configuration",
                                  "cn=two," + book("one"), "dc=example,dc=com",
                                  "cn=xcn\\3dconfiguration"])
@pytest.mark.parametrize("scope", [ldap.SCOPE_BASE, ldap.SCOPE_SUBTREE])
def test_missing_base_is_answered_32(admin, base, scope):
    with pytest.raises(ldap.NO_SUCH_OBJECT):
        clients.search(admin, base, scope)


@pytest.mark.parametrize("base", [b"configuration", b"cn=a,,cn=configuration", b"=configuration",
                                  b"cn=#zz,cn=configuration", b"cn=a\\,cn=configuration\\",
                                  b"cn=a\x00b,cn=configuration", b"cn=\xff,cn=configuration",
                                  b"cn=\"a\",cn=configuration\"", b",cn=configuration"])
def test_base_that_is_no_dn_is_answered_34(shelf, base):
    with wire.bound(shelf) as connection:
        assert connection.search(2, base=base) == (34, 0)
        assert connection.search(3) == (0, 1)


def test_size_limit_of_the_client_ends_the_search_with_4(shelf):
    found = clients.command("ldapsearch", shelf, "-LLL", "-z", "2", "-b", SHELF)
    assert found.returncode == 4
    assert len(clients.parse_ldif(found.stdout)) == 2


def test_size_limit_that_is_just_enough_is_no_error(shelf):
    found = clients.command("ldapsearch", shelf, "-LLL", "-z", str(1 + len(BOOKS)), "-b", SHELF)
    assert found.returncode == 0
    assert len(clients.parse_ldif(found.stdout)) == 1 + len(BOOKS)


def test_size_limit_of_the_server_holds_for_everybody(instance):
    instance.config.set(clients.BASE, "orv-slapdSizeLimit", "3")
    instance.start()
    for wanted, given in (("0", 3), ("2", 2), ("1000", 3)):
        found = clients.command("ldapsearch", instance, "-LLL", "-z", wanted, "-b", clients.BASE)
        assert found.returncode == 4
        assert len(clients.parse_ldif(found.stdout)) == given


def slow_filter(items):
    """A filter that costs much and matches nothing."""
    return wire.any_of(*[
        wire.tlv(0xA4, wire.octets("description")
                 + wire.tlv(0x30, wire.octets("%04d" % item, 0x81) + wire.octets("zz", 0x81)))
        for item in range(items)])


def big_instance(instance, entries=20000):
    text = [record("cn=e%d,cn=schemas,cn=configuration" % i,
                   [("objectClass", ["top", "container"]), ("cn", "e%d" % i),
                    ("description", "0123456789 and so on " * 8)]) for i in range(entries)]
    instance.config.append(b"\n".join(text))
    return instance


def test_time_limit_of_the_client_ends_the_search_with_3(instance):
    big_instance(instance).start()
    with wire.bound(instance) as connection:
        assert connection.search(2, scope=2, search_filter=slow_filter(1000),
                                 time_limit=1) == (3, 0)
        assert connection.search(3) == (0, 1)


def test_time_limit_of_the_server_ends_the_search_with_3(instance):
    instance.config.set(clients.BASE, "orv-slapdTimeLimit", "1")
    big_instance(instance).start()
    with wire.bound(instance) as connection:
        assert connection.search(2, scope=2, search_filter=slow_filter(1000)) == (3, 0)


def test_large_answer_arrives_whole(instance):
    big_instance(instance).start()
    client = clients.bind(instance)
    found = clients.search(client, "cn=schemas,cn=configuration",
                           filter_text="(description=*so on*)")
    assert len(found) == 20000


def test_manage_dsa_it_is_accepted_even_when_critical(shelf):
    found = clients.command("ldapsearch", shelf, "-LLL", "-MM", "-s", "base", "-b", SHELF, "cn")
    assert found.returncode == 0, found.stderr
    assert set(clients.parse_ldif(found.stdout)) == {SHELF}


def test_abandoned_search_leaves_the_connection_usable(admin):
    abandoned = admin.search("cn=configuration", ldap.SCOPE_SUBTREE)
    admin.abandon(abandoned)
    assert set(clients.search(admin, SHELF, ldap.SCOPE_BASE)) == {SHELF}


def test_abandon_of_an_operation_that_never_was_is_ignored(shelf):
    with wire.bound(shelf) as connection:
        connection.send(wire.abandon_request(2, 77))
        assert connection.search(3) == (0, 1)


def test_abandon_ends_a_running_search_without_an_answer(instance):
    big_instance(instance).start()
    with wire.bound(instance) as connection, wire.bound(instance) as other:
        connection.send(wire.search_request(2, scope=2, search_filter=slow_filter(1300)))
        connection.send(wire.abandon_request(3, 2) + wire.search_request(4))
        assert connection.search_result(4) == (0, 1)
        assert other.search(2) == (0, 1)


def test_search_of_a_client_that_leaves_ends(instance):
    big_instance(instance).start()
    with wire.bound(instance) as leaving, wire.bound(instance) as other:
        leaving.send(wire.search_request(2, scope=2, search_filter=slow_filter(1300)))
        leaving.close()
        assert other.search(2) == (0, 1)


def test_filter_with_too_many_items_is_refused_with_11(shelf):
    with wire.bound(shelf) as connection:
        assert connection.search(2, search_filter=slow_filter(3000)) == (11, 0)
        assert connection.search(3) == (0, 1)
