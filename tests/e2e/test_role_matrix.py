"""Who may add and delete which entry: every set of roles against every protected entry.

What is expected comes from a small model of the rules below, not from the code under test. The
server's own guards are left out here, so that the backend's rules answer alone.
"""

import itertools

import ldap
import pytest

from orv_e2e import changes, clients, programs
from orv_e2e.changes import GROUP, LOGS, add, delete

ROLES = {"AuditAdmin": 0x02, "ReplicationAdmin": 0x0C, "SchemaAdmin": 0x10,
         "ServerConfigGroupMember": 0x20}
PASSWORD = "in the open"

BACKENDS = "cn=orv directory,cn=schemas,cn=configuration"
DIGEST = ("cn=digest,cn=configuration",
          {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdDigest"], "cn": ["digest"]})
KERBEROS = ("cn=kerberos,cn=configuration",
            {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdKerberos"],
             "cn": ["kerberos"], "orv-slapdKrbAdminDN": ["orv-kn=root@EXAMPLE.COM"]})


def log_entry(name, kind="orv-slapdLogSettings"):
    return "cn=%s,%s" % (name, LOGS), {
        "objectClass": ["top", "orv-slapdConfigEntry", kind], "cn": [name]}


ENTRIES = {
    "audit": log_entry("audit", "orv-auditConfig"),
    "admin audit": log_entry("admin audit"),
    "default": log_entry("default"),
    "replication": ("cn=replication,cn=configuration",
                    {"objectClass": ["top", "orv-slapdConfigEntry",
                                     "orv-slapdReplicationSettings"], "cn": ["replication"]}),
    "master server": changes.supplier("master server", kind="orv-slapdReplication",
                                      dn="cn=master server,cn=configuration"),
    "supplier": changes.supplier("anywhere", dn="cn=anywhere," + changes.PLACE),
    "ordinary": changes.container("ordinary"),
    "policy": ("cn=pwdpolicy admin,cn=configuration",
               {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdAdminPolicy"],
                "cn": ["pwdpolicy admin"]}),
    "pass-through": changes.pass_through("partner", "ou=partner,o=example"),
    "member": changes.member("newcomer"),
    "kerberos": KERBEROS,
    "digest": DIGEST,
    "config backend": ("cn=configdb,cn=config backends," + BACKENDS,
                       {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdBackendEntry"],
                        "cn": ["configdb"]}),
}
OF_THE_PRIMARY_ALONE = ("member", "kerberos", "digest")


def role_sets():
    for count in range(len(ROLES) + 1):
        yield from itertools.combinations(ROLES, count)


def bits_of(roles):
    return sum(ROLES[role] for role in roles)


def has_authority(bits, entry):
    """What adding and deleting ask of the roles alike."""
    if not bits & 0x3E:
        return False
    if entry in ("audit", "admin audit"):
        return bool(bits & 0x02)
    if entry == "default":
        return bool(bits & 0x22)
    if entry == "replication":
        return bool(bits & 0x2C)
    if entry in ("master server", "supplier"):
        return bits & 0x34 == 0x34
    return bool(bits & 0x20)


def expected(bits, entry, operation):
    if not has_authority(bits, entry):
        return 50
    if entry == "config backend" and operation == "delete":
        return 53
    return 50 if entry in OF_THE_PRIMARY_ALONE else 0


def name_of(roles):
    return "with" + "".join(str(list(ROLES).index(role)) for role in roles)


@pytest.fixture(scope="module", name="members")
def members_fixture(module_instance):
    """A client for each set of roles, and one of the primary administrator under ()."""
    for roles in role_sets():
        # A member without any of the four still has a role.
        module_instance.config.add_member(name_of(roles), PASSWORD, roles or ["PasswordAdmin"])
    module_instance.start("--without-guards")
    bound = {roles: clients.bind(module_instance, "cn=" + name_of(roles), PASSWORD)
             for roles in role_sets()}
    bound["root"] = clients.bind(module_instance)
    yield bound
    for client in bound.values():
        client.unbind_s()


def is_there(root, dn):
    try:
        return bool(root.search_s(dn, ldap.SCOPE_BASE, attrlist=["1.1"]))
    except ldap.NO_SUCH_OBJECT:
        return False


def put(root, dn, attributes):
    if not is_there(root, dn):
        assert add(root, dn, attributes) == 0


def take_away(root, dn):
    if is_there(root, dn):
        assert delete(root, dn) == 0


@pytest.mark.parametrize("entry", ENTRIES)
def test_members_delete_what_their_roles_cover(members, entry):
    root = members["root"]
    dn, attributes = ENTRIES[entry]
    put(root, dn, attributes)
    found = {}
    for roles in role_sets():
        found[roles] = delete(members[roles], dn)
        put(root, dn, attributes)
    assert found == {roles: expected(bits_of(roles), entry, "delete") for roles in role_sets()}
    if entry not in ("config backend",):
        assert delete(root, dn) == 0


@pytest.mark.parametrize("entry", [name for name in ENTRIES if name != "config backend"])
def test_members_add_what_their_roles_cover(members, entry):
    root = members["root"]
    dn, attributes = ENTRIES[entry]
    found = {}
    for roles in role_sets():
        take_away(root, dn)
        found[roles] = add(members[roles], dn, attributes)
    assert found == {roles: expected(bits_of(roles), entry, "add") for roles in role_sets()}
    put(root, dn, attributes)


def test_supplier_and_stranger_change_nothing(members, module_instance):
    root = members["root"]
    take_away(root, ENTRIES["supplier"][0])
    put(root, *changes.supplier("changer", bind_dn="cn=changer"))
    strangers = [clients.connect(module_instance),
                 clients.bind(module_instance, "cn=changer", changes.PASSWORD)]
    for client in strangers:
        for entry, (dn, attributes) in ENTRIES.items():
            assert add(client, dn, attributes) == 50, entry
            assert delete(client, dn) == 50, entry
        client.unbind_s()


# ---- other spellings of the same

# Legal spellings of CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION, which meet the rule ...
SPELLINGS_OF_AUDIT = [
    "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION", "cn=Audit , cn = Log  Management,cn=Configuration",
    "  cn=audit,cn=log management,cn=configuration  ",
    "2.5.4.3=audit,cn=log management,cn=configuration",
    "commonName=audit,cn=log management,cn=configuration",
    "cn=\\61udit,cn=log\\20management,cn=configuration",
    "cn=#04056175646974,cn=log management,cn=configuration",
    "cn=audit,cn=log management,cn=#040D436F6E66696775726174696F6E",
    "cn=\uff41\uff55\uff44\uff49\uff54,cn=log management,cn=configuration",  # full width
    "cn=au\u00addit,cn=log management,cn=configuration"]              # soft hyphen
# ... and texts that are no DNs by RFC 4514.
NO_DNS = [
    "oid.2.5.4.3=audit,cn=log management,cn=configuration",
    "cn=audit;cn=log management;cn=configuration",
    "cn=\"audit\",cn=log management,cn=configuration",
    "cn=#0405617564697,cn=log management,cn=configuration",
    "cn=#0406617564697400,cn=log management,cn=configuration",
    "cn=audit\\00,cn=log management,cn=configuration",
    "cn=audit,,cn=log management,cn=configuration",
    "cn;lang-en=audit,cn=log management,cn=configuration"]


@pytest.mark.parametrize("spelling, code", [(spelling, 50) for spelling in SPELLINGS_OF_AUDIT]
                         + [(text, 34) for text in NO_DNS])
def test_no_spelling_of_a_name_steps_around_a_rule(members, spelling, code):
    root = members["root"]
    clerk = members[("ServerConfigGroupMember",)]
    dn, attributes = ENTRIES["audit"]
    put(root, dn, attributes)
    assert delete(clerk, spelling) == code
    take_away(root, dn)
    assert add(clerk, spelling, attributes) == (code if programs.fits_code_page(spelling) else 21)
    assert not is_there(root, dn)
    put(root, dn, attributes)


@pytest.mark.parametrize("place", [
    GROUP, "cn=admin\\67roup,cn=configuration", "2.5.4.3=AdminGroup,CN=\\43onfiguration",
    "cn = ADMINGROUP , cn = configuration", "cn=#040A41444D494E47524F5550,cn=configuration"])
def test_no_spelling_of_the_group_lets_a_member_in(members, place):
    clerk = members[("ServerConfigGroupMember",)]
    _, attributes = changes.member("intruder")
    assert add(clerk, "cn=intruder," + place, attributes) == 50
    assert not is_there(members["root"], "cn=intruder," + GROUP)


@pytest.mark.parametrize("type_name", ["objectClass", "OBJECTCLASS", "2.5.4.0"])
@pytest.mark.parametrize("class_name, code", [
    ("orv-slapdSupplier", 50), ("ORV-SLAPDSUPPLIER", 50), (None, 50),
    ("orv-slapdSupplier ", 65), ("orv-slapdSupplier\0", 21)])
def test_no_spelling_of_a_class_makes_a_supplier(members, type_name, class_name, code):
    clerk = members[("ServerConfigGroupMember",)]
    given = class_name or changes.numbers_of_classes()["orv-slapdSupplier"]
    dn, attributes = changes.supplier("smuggled", dn="cn=smuggled," + changes.PLACE)
    del attributes["objectClass"]
    attributes[type_name] = ["top", "orv-slapdConfigEntry", given]
    assert add(clerk, dn, attributes) == code
    assert not is_there(members["root"], dn)


@pytest.mark.parametrize("type_name, code", [
    ("orv-slapdMasterDN;x", 17), ("objectClass;x", 17), ("cn;lang-en", 17), ("noSuchType", 17)])
def test_options_and_unknown_types_are_refused(members, type_name, code):
    dn, attributes = changes.container("optioned")
    attributes[type_name] = ["cn=x"]
    assert add(members[("ServerConfigGroupMember",)], dn, attributes) == code


def test_types_by_number_are_stored_under_their_names(members, module_instance):
    numbers = changes.numbers_of_classes()
    dn, attributes = changes.member("numbered")
    by_number = {numbers.get(name, name): values for name, values in attributes.items()}
    by_number[numbers["objectClass"]] = [numbers[name] for name in attributes["objectClass"]]
    assert add(members["root"], dn, by_number) == 0
    stored = clients.parse_ldif(module_instance.config.read())[dn]
    assert set(attributes) < set(stored)
    assert stored["objectClass"] == [name.encode() for name in attributes["objectClass"]]
    take_away(members["root"], dn)


# ---- the order of the checks

def test_roles_are_asked_for_only_where_an_entry_fits_the_schema(members):
    idle = members[()]
    dn, attributes = changes.container("misfit")
    misfit = {**attributes, "orv-slapdPort": ["1"]}
    assert add(idle, dn, attributes) == 50
    assert add(idle, dn, misfit) == 65
    assert add(idle, "cn=schemas,cn=configuration", misfit) == 68
    assert add(idle, "cn=misfit,cn=nowhere,cn=configuration", misfit) == 32
    # What is decided without the configuration comes before all of this.
    assert add(idle, "cn=schemas,cn=configuration", {**misfit, "noSuchType": ["x"]}) == 17
    assert add(idle, "cn=misfit", misfit) == 32
    assert add(idle, "", misfit) == 53
    assert add(idle, "misfit", misfit) == 34
    assert not is_there(members["root"], dn)


def test_missing_entry_is_told_before_the_roles(members):
    assert delete(members[()], "cn=nowhere,cn=configuration") == 32
    assert changes.modify(members[()], "cn=nowhere,cn=configuration",
                          changes.replaced("description", "x")) == 32
    assert delete(members[()], "cn=schemas,cn=configuration") == 50
