"""No spelling of a DN, of an attribute type or of an object class steps around a rule of modify.

Each spelling has its exact code: legal ones meet the rule (50), the others are refused for what they
are. The server's own guards are left out, so that the backend's rules answer alone.
"""

import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import GROUP, added, deleted, modify, replaced

PASSWORD = "in the open 1"
NEW_PASSWORD = "Qm4&wt8?Lb6%"
NUMBERS = changes.numbers_of_classes()
ADMIN_PW = NUMBERS["orv-slapdAdminPW"]
TOP = "cn=configuration"
HEX_TOP = "cn=#040D434F4E46494755524154494F4E"


@pytest.fixture(scope="module", name="places")
def places_fixture(module_instance):
    instance = module_instance
    instance.config.add_member("clerk", PASSWORD, ["ServerConfigGroupMember"])
    instance.config.add_member("auditor", PASSWORD, ["AuditAdmin"])
    instance.config.add_member("idle", PASSWORD, ["PasswordAdmin"])
    instance.config.add("cn=kerberos," + TOP, [
        ("objectClass", ["top", "orv-slapdConfigEntry", "orv-slapdKerberos"]), ("cn", "kerberos"),
        ("orv-slapdKrbAdminDN", "orv-kn=root@EXAMPLE.COM")])
    instance.config.add("cn=feeder,cn=replication," + TOP, [
        ("objectClass", ["top", "orv-slapdConfigEntry", "orv-slapdSupplier"]), ("cn", "feeder"),
        ("orv-slapdMasterDN", "cn=feeder"), ("orv-slapdMasterPW", PASSWORD),
        ("orv-slapdMasterSuffix", "o=fed")])
    return instance.start("--without-guards")


def refused(instance, who, dn, *modifications):
    """The code of a modify that has to change nothing."""
    before = instance.config.read()
    client = clients.bind(instance, "cn=" + who, PASSWORD)
    code = modify(client, dn, *modifications)
    client.unbind_s()
    assert instance.config.read() == before
    return code


# Who is refused at which entry: by the backend's table of roles, or by a rule on the entry.
PROTECTED = {
    "cn=audit,cn=log management,cn=configuration": "clerk",
    "cn=admin audit,cn=log management,cn=configuration": "clerk",
    "cn=pwdpolicy admin,cn=configuration": "clerk",
    "cn=admingroup,cn=configuration": "clerk",
    "cn=auditor,cn=admingroup,cn=configuration": "clerk",
    "cn=feeder,cn=replication,cn=configuration": "clerk",
    "cn=passthrough authentication,cn=configuration": "auditor",
    "cn=replication,cn=configuration": "auditor",
    "cn=orv directory,cn=schemas,cn=configuration": "auditor",
    "cn=default,cn=log management,cn=configuration": "idle",
    "cn=log management,cn=configuration": "idle",
}


def escaped(dn):
    """The first letter of each value as a hexadecimal pair."""
    parts = [part.split("=") for part in dn.split(",")]
    return ",".join("%s=\\%02x%s" % (name, ord(value[0]), value[1:]) for name, value in parts)


def in_hex(dn):
    parts = [part.split("=")[1] for part in dn.split(",")]
    return ",".join("2.5.4.3=#04%02x%s" % (len(part), part.encode().hex()) for part in parts)


SPELLINGS = {
    "as it is": (lambda dn: dn, 50),
    "capitals": (lambda dn: dn.upper(), 50),
    "blanks": (lambda dn: " " + dn.replace(",", " , ").replace("=", " =  ") + " ", 50),
    "blanks inside": (lambda dn: dn.replace(" ", "   "), 50),
    "type by number": (lambda dn: dn.replace("cn=", "2.5.4.3="), 50),
    "type by its long name": (lambda dn: dn.replace("cn=", "CommonName="), 50),
    "escapes": (escaped, 50),
    "hexadecimal": (in_hex, 50),
    "top in hexadecimal": (lambda dn: dn.replace(TOP, HEX_TOP), 50),
    "soft hyphens": (lambda dn: dn.replace("cn=", "cn=\u00ad"), 50),
    "prefix oid.": (lambda dn: dn.replace("cn=", "oid.2.5.4.3="), 34),
    "options": (lambda dn: dn.replace("cn=", "cn;lang-en="), 34),
    "semicolons": (lambda dn: dn.replace(",", ";"), 34),
    "quotes": (lambda dn: 'cn="' + dn[3:].replace(",", '",', 1), 34),
    "zero at the end": (lambda dn: dn.replace("," + TOP, "\\00," + TOP), 34),
    # Other names, of which there are no entries.
    "blank in front, escaped": (lambda dn: "cn=\\20" + dn[3:], 32),
    "comma that belongs to the value": (lambda dn: dn.replace("," + TOP, "\\," + TOP), 32),
    "twice in one component": (lambda dn: dn.split(",")[0] + "+" + dn, 32),
}


@pytest.mark.parametrize("spelling", SPELLINGS)
@pytest.mark.parametrize("target", PROTECTED)
def test_no_spelling_of_a_protected_entry_is_let_through(places, target, spelling):
    respell, code = SPELLINGS[spelling]
    assert refused(places, PROTECTED[target], respell(target),
                   replaced("description", "changed")) == code


# ---- attribute types

TYPES = [("orv-slapdAdminPW", 50), ("ORV-SLAPDADMINPW", 50), (ADMIN_PW, 50),
         ("orv-slapdAdminPW;x", 17), ("orv-slapdAdminPW;binary", 17), (ADMIN_PW + ";x", 17),
         (ADMIN_PW + ".0", 17),
         # No attribute descriptions by RFC 4512, 2.5.
         ("oid." + ADMIN_PW, 2), ("orv-slapdAdminPW;", 2), ("orv-slapdAdminPW ", 2),
         (" orv-slapdAdminPW", 2), ("orv_slapdAdminPW", 2), ("orv-slapdAdm\u0131nPW", 2), ("", 2)]


@pytest.mark.parametrize("name, code", TYPES)
def test_no_spelling_of_a_type_lets_a_member_set_the_administrator(places, name, code):
    assert refused(places, "clerk", TOP, replaced(name, NEW_PASSWORD)) == code
    assert refused(places, "clerk", TOP, deleted(name)) == code
    assert refused(places, "clerk", TOP, replaced("description", "x"),
                   replaced(name, NEW_PASSWORD)) == code


@pytest.mark.parametrize("name, code", TYPES)
def test_no_spelling_of_a_type_changes_somebody_elses_password(places, name, code):
    assert refused(places, "clerk", "cn=auditor," + GROUP, replaced(name, NEW_PASSWORD)) == code
    # Two modifications of the own password are one too many, under whatever names.
    assert refused(places, "clerk", "cn=clerk," + GROUP, replaced("orv-slapdAdminPW", NEW_PASSWORD),
                   replaced(name, NEW_PASSWORD)) == code


@pytest.mark.parametrize("name, dn, value", [
    ("orv-slapdAdminDN", TOP, "cn=clerk too"), ("orv-slapdAdminGroupEnabled", TOP, "FALSE"),
    ("orv-slapdKrbAdminDN", "cn=kerberos," + TOP, "orv-kn=clerk@EXAMPLE.COM"),
    ("orv-slapdDigestAdminUser", "cn=digest," + TOP, "clerk")])
def test_names_and_numbers_of_a_type_are_one(places, name, dn, value):
    for spelling in (name, name.upper(), name.swapcase(), NUMBERS[name]):
        assert refused(places, "clerk", dn, replaced(spelling, value)) == 50
        assert refused(places, "clerk", dn, added("description", "x"),
                       replaced(spelling, value)) == 50
    assert refused(places, "clerk", dn, replaced(name + ";x", value)) == 17


@pytest.mark.parametrize("spelling", ["orv-slapdSuffix", "ORV-SLAPDSUFFIX",
                                      NUMBERS["orv-slapdSuffix"]])
def test_supplier_adds_its_suffix_under_any_name_of_the_type_and_no_other(places, spelling):
    directory = "cn=directory,cn=rdbm backends,cn=orv directory,cn=schemas,cn=configuration"
    before = places.config.read()
    supplier = clients.bind(places, "cn=feeder", PASSWORD)
    assert modify(supplier, directory, added(spelling, "o=other")) == 50
    assert modify(supplier, directory, replaced(spelling, "o=fed")) == 50
    assert modify(supplier, directory, added(spelling + ";x", "o=fed")) == 17
    assert places.config.read() == before
    assert modify(supplier, directory.upper(), added(spelling, "O = Fed")) == 0
    supplier.unbind_s()
    places.config.replace(before)


# ---- object classes

@pytest.mark.parametrize("type_name", ["objectClass", "OBJECTCLASS", "2.5.4.0"])
@pytest.mark.parametrize("class_name, code", [
    ("orv-slapdSupplier", 69), ("ORV-SLAPDSUPPLIER", 69), (NUMBERS["orv-slapdSupplier"], 69),
    ("orv-slapdSupplier ", 69), ("noSuchClass", 69), ("orv-slapdSupplier\0", 21)])
def test_no_spelling_of_a_class_makes_a_supplier_of_an_entry(places, type_name, class_name, code):
    change = (added(type_name, class_name), added("orv-slapdMasterDN", "cn=smuggled"),
              added("orv-slapdMasterPW", NEW_PASSWORD))
    assert refused(places, "clerk", "cn=schemas," + TOP, *change) == code


# ---- values

def test_same_bind_dn_in_another_spelling_is_the_same_identity(places):
    root = clients.bind(places)
    for spelling in ("CN=AUDITOR", "cn = auditor", "2.5.4.3=auditor", "cn=\\61uditor",
                     "cn=#04" + "07" + b"auditor".hex(), "commonName=Auditor"):
        before = places.config.read()
        assert modify(root, TOP, replaced("orv-slapdAdminDN", spelling)) == 68, spelling
        assert modify(root, "cn=clerk," + GROUP, replaced("orv-slapdAdminDN", spelling)) == 68
        assert modify(root, "cn=feeder,cn=replication," + TOP,
                      replaced("orv-slapdMasterDN", spelling)) == 68
        assert places.config.read() == before
    root.unbind_s()


def test_unknown_roles_are_refused_in_every_place_of_the_list(places):
    root = clients.bind(places)
    before = places.config.read()
    dn = "cn=auditor," + GROUP
    assert modify(root, dn, added("orv-slapdAdminRole", "Wizard")) == 80
    assert modify(root, dn, added("orv-slapdAdminRole", "SchemaAdmin", "Wizard")) == 80
    assert modify(root, dn, replaced("orv-slapdAdminRole", "AuditAdmin ", "Audit  Admin")) == 80
    assert modify(root, dn, deleted("orv-slapdAdminRole", "AuditAdmin"),
                  added("orv-slapdAdminRole", "Wizard")) == 80
    assert places.config.read() == before
    root.unbind_s()
