"""What no added entry may be, whoever sends it: each rule with its code, the text that the client
gets, and a file that stays as it was."""

import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import GROUP, PASSWORD, added, container, encoded, member

TOP = "cn=configuration"
PASS_THROUGH = "cn=passthrough authentication," + TOP
PROXY = "cn=proxydb,cn=proxy backends,cn=orv directory,cn=schemas," + TOP
BAD_ROLE = (80, "Invalid administrative role value")


def answer(client, dn, attributes):
    """The code and the text of an add."""
    return clients.answer_of(client.add_s, dn, encoded(attributes))


@pytest.fixture(name="add")
def add_fixture(server, root):
    """The answer to an add by the primary administrator; one that is refused changes nothing."""
    def add(dn, attributes):
        before = server.config.read()
        found = answer(root, dn, attributes)
        assert (server.config.read() == before) == (found[0] != 0)
        return found
    return add


def stored(instance, dn, name):
    return clients.parse_ldif(instance.config.read())[dn].get(name, [])


def bound_member(server, root, name, *roles):
    assert changes.add(root, *member(name, roles=roles)) == 0
    return clients.bind(server, "cn=" + name, PASSWORD)


# ---- what is answered

def test_refused_adds_carry_no_text(root, add):
    assert add(*member("first", KrbAdminDN="orv-kn=first@R", DigestAdminUser="first")) == (0, "")
    near, supplier = changes.supplier("near", bind_dn="CN=First")
    refused = [
        (member("first"), 68), (container("x", "cn=nowhere," + TOP), 32),
        (member("second", bind_dn="CN = Root"), 68), (member("second", bind_dn="CN=First"), 68),
        (member("second", KrbAdminDN="ORV-KN=FIRST@R"), 68),
        (member("second", KrbAdminDN="cn=second@R"), 80),
        (member("second", DigestAdminUser="first"), 68), ((near, supplier), 68),
        (member("second", password="short"), 19),
        (changes.pass_through("reserved", "cn=schema"), 19),
        (changes.pass_through("url", "o=x", url="nonsense"), 21),
        (container("context", objectClass=["top", "container", "orv-replicationContext"]), 92)]
    for entry, code in refused:
        assert add(*entry) == (code, ""), entry


def test_existence_and_parent_are_told_before_what_the_schema_refuses(add):
    misfit = {"objectClass": ["top", "container"], "cn": ["x"], "orv-slapdPort": ["1"]}
    assert add("cn=digest," + TOP, misfit)[0] == 68
    assert add("cn=x,cn=nowhere," + TOP, misfit)[0] == 32
    assert add("cn=x,cn=schemas," + TOP, misfit)[0] == 65


def test_entry_without_authority_is_refused_whether_it_exists_or_not(server, root):
    clerk = bound_member(server, root, "clerk", "AuditAdmin")
    assert answer(clerk, *container("new")) == (50, "")
    assert answer(clerk, "cn=schemas," + TOP, container("schemas")[1]) == (50, "")
    assert answer(clerk, *container("new", "cn=nowhere," + TOP)) == (50, "")
    clerk.unbind_s()


@pytest.mark.parametrize("spelled", ["name", "number", "type by number", "another letter case"])
def test_object_class_in_a_name_counts_like_one_in_the_list(server, root, add, spelled):
    def named_by(object_class, parent, attributes):
        number = changes.numbers_of_classes()[object_class]
        rdn = {"name": "objectClass=" + object_class, "number": "objectClass=" + number,
               "type by number": "2.5.4.0=" + number,
               "another letter case": "OBJECTCLASS=" + object_class.upper()}[spelled]
        rest = [each for each in attributes["objectClass"] if each != object_class]
        return f"{rdn},{parent}", dict(attributes, objectClass=rest)

    helper = bound_member(server, root, "helper", "ServerConfigGroupMember")
    assert answer(helper, *container("ordinary")) == (0, "")
    place = "cn=replication," + TOP
    supplier = named_by("orv-slapdSupplier", place, changes.supplier("evil")[1])
    assert answer(helper, *supplier) == (50, "")
    helper.unbind_s()
    replication = changes.supplier("evil", kind="orv-slapdReplication")[1]
    assert add(*named_by("orv-slapdReplication", place, replication))[0] == 53
    context = container("x", objectClass=["top", "container", "orv-replicationContext"])[1]
    assert add(*named_by("orv-replicationContext", TOP, context)) == (92, "")
    assert add(*supplier) == (0, "")
    assert clients.bind_code(server, "cn=evil supplier", PASSWORD) == 0


# ---- roles

def test_unknown_role_is_told_before_everything_else(server, root, add):
    assert add(*member("carol")) == (0, "")
    assert add(*member("odd", roles=["SchemaAdmin", "Emperor"])) == BAD_ROLE
    assert add(*member("carol", roles=["Emperor"])) == BAD_ROLE  # who exists
    dn, attributes = member("odd", roles=["NoAdmin", "Emperor"])
    del attributes["orv-slapdAdminDN"]  # which the schema asks for
    assert add(dn, attributes) == BAD_ROLE
    assert add("cn=odd,cn=nowhere," + GROUP, attributes) == BAD_ROLE


def test_roles_keep_their_letter_case(server, add):
    dn, attributes = member("carol", roles=["auditadmin", "SCHEMAADMIN"])
    assert add(dn, attributes) == (0, "")
    assert stored(server, dn, "orv-slapdAdminRole") == [b"auditadmin", b"SCHEMAADMIN"]


def test_no_admin_among_the_roles_is_the_only_one(server, root, add):
    dn, attributes = member("carol", roles=["SchemaAdmin", "noadmin", "AuditAdmin"])
    assert add(dn, attributes) == (0, "")
    assert stored(server, dn, "orv-slapdAdminRole") == [b"NoAdmin"]
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert changes.delete(carol, "cn=audit," + changes.LOGS) == 50
    carol.unbind_s()


def test_member_without_roles_gets_the_defaults_in_their_order(server, add):
    dn, attributes = member("carol")
    assert add(dn, attributes) == (0, "")
    assert stored(server, dn, "orv-slapdAdminRole") == [
        b"DirDataAdmin", b"PasswordAdmin", b"SchemaAdmin", b"ServerConfigGroupMember",
        b"ServerStartStopAdmin"]


# ---- the group

def test_container_of_the_group_is_made_anew_by_the_primary_administrator_alone(server, root, add):
    clerk = bound_member(server, root, "clerk", "ServerConfigGroupMember")
    assert answer(clerk, *member("intruder")) == (50, "")
    assert answer(clerk, GROUP, container("admingroup")[1]) == (50, "")
    clerk.unbind_s()
    assert changes.delete(root, "cn=clerk," + GROUP) == 0
    assert changes.delete(root, GROUP) == 0
    config_entry = {"objectClass": ["top", "orv-slapdConfigEntry"], "cn": ["admingroup"]}
    assert add(GROUP, config_entry) == (65, "")
    assert add(*member("early")) == (32, "")
    assert add(GROUP, container("admingroup")[1]) == (0, "")
    assert stored(server, GROUP, "orv-slapdAdminRole") == []
    assert add(*member("carol")) == (0, "")


def test_identities_are_compared_with_nobody_where_there_is_no_group(server, root, add):
    assert changes.delete(root, GROUP) == 0
    assert changes.delete(root, "cn=digest," + TOP) == 0
    assert add(*changes.supplier("near", bind_dn="cn=near")) == (0, "")
    assert add(*changes.supplier("root", bind_dn="CN=Root")) == (68, "")
    assert add("cn=digest," + TOP, {
        "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdDigest"], "cn": ["digest"],
        "orv-slapdDigestAdminUser": ["root"]}) == (0, "")


def test_no_identity_is_added_while_the_administrators_is_in_doubt(instance):
    instance.config.set(TOP, "orv-slapdAdminDN", "cn=root", "cn=second")
    root = clients.bind(instance.start())
    before = instance.config.read()
    assert answer(root, *member("carol")) == (80, "")
    assert answer(root, *changes.supplier("near")) == (80, "")
    assert instance.config.read() == before
    assert answer(root, *container("anything else")) == (0, "")
    root.unbind_s()


def test_member_without_a_bind_dn_or_of_another_class_is_refused(add):
    dn, attributes = member("odd")
    del attributes["orv-slapdAdminDN"]
    assert add(dn, attributes) == (65, "")
    assert add(*container("odd", GROUP)) == (65, "")
    dn, attributes = member("odd")
    attributes["objectClass"] = ["top", "orv-slapdConfigEntry", "orv-slapdTop"]
    assert add(dn, attributes) == (65, "")


# ---- split proxies

def test_names_of_a_split_proxy_are_letters_and_digits_and_nobody_elses(add):
    def part(name, split_name):
        return "cn=%s,%s" % (name, PROXY), {
            "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdProxySplit"], "cn": [name],
            "orv-slapdProxySplitName": [split_name]}
    assert add(*part("one", "part 1")) == (21, "")
    assert add(*part("one", "part1")) == (0, "")
    assert add(*part("two", "part1")) == (68, "")
    assert add(*part("two", "PART1")) == (0, "")


# ---- pass-through authentication

def test_pass_through_entries_stand_directly_below_their_container(instance):
    root = clients.bind(instance.start())
    assert changes.add(root, *changes.pass_through("one", "o=one")) == 0
    dn, attributes = changes.pass_through("deep", "o=deep")
    before = instance.config.read()
    assert answer(root, dn.replace("deep", "deep,cn=one", 1), attributes) == (53, "")
    assert answer(root, *container("box", "cn=one," + PASS_THROUGH)) == (53, "")
    assert answer(root, *container("box", PASS_THROUGH)) == (65, "")
    assert instance.config.read() == before
    root.unbind_s()


def test_container_of_pass_through_entries_cannot_be_added(instance):
    instance.config.remove(PASS_THROUGH)
    root = clients.bind(instance.start())
    assert answer(root, PASS_THROUGH, container("passthrough authentication")[1]) == (53, "")
    root.unbind_s()


def test_url_of_a_pass_through_entry_is_looked_at_before_its_subtrees(add):
    assert add(*changes.pass_through("x", "cn=schema", "o=a", url="nonsense")) == (21, "")
    for subtrees in (["cn=schema"], ["ou=x,cn=configuration"], ["o=a", "ou=b,o=a"],
                     ["ou=b,o=a", "o=a"]):
        assert add(*changes.pass_through("x", *subtrees)) == (19, ""), subtrees


def test_entry_does_not_overlap_with_its_own_subtrees(root, add):
    dn, attributes = changes.pass_through("one", "o=one")
    assert add(dn, attributes) == (0, "")
    assert changes.modify(root, dn, changes.replaced("orv-slapdPtaURL", "ldap://other")) == 0
    assert changes.modify(root, dn, added("orv-slapdPtaSubtree", "o=two")) == 0
    assert add(*changes.pass_through("two", "ou=x,o=two")) == (19, "")


def test_entry_of_the_file_without_subtrees_is_in_the_way_of_every_other(instance):
    dn, attributes = changes.pass_through("by hand", "o=none")
    del attributes["orv-slapdPtaSubtree"]
    instance.config.add(dn, list(attributes.items()))
    root = clients.bind(instance.start())
    assert answer(root, *changes.pass_through("one", "o=one")) == (1, "")
    assert changes.delete(root, dn) == 0
    assert answer(root, *changes.pass_through("one", "o=one")) == (0, "")
    root.unbind_s()
