"""Who may bind, with what, and what follows from it."""

import base64
import hashlib
import os
import re
import subprocess

import ldap
import pytest

from orv_e2e import clients, programs, wire

MASTER = "cn=master server,cn=configuration"


@pytest.fixture(scope="module", name="people")
def people_fixture(module_instance):
    """A running instance with members whose passwords are stored in every form, and suppliers."""
    config = module_instance.config
    config.add_member("clear", "in the open")
    config.add_member("hashed", ssha512("salted"))
    config.add_member("ssha256", ssha(hashlib.sha256, "{SSHA256}", "salted 256"))
    config.add_member("ssha", ssha(hashlib.sha1, "{SSHA}", "salted 1"))
    config.add_member("derived", pbkdf2("derived"))
    config.add_member("unknown", "{ROT13}frperg")
    config.add_member("malformed", "{SSHA512}!!!!")
    config.add_member("inside", "in the open", bind_dn="cn=digest,cn=configuration")
    config.add_member("twin1", "twin password", bind_dn="cn=twin")
    config.add_member("twin2", "twin password", bind_dn="CN = Twin")
    config.add_member("unassigned", "in the open", roles=["NoAdmin"])
    config.add_member("thief", admin_password_as_stored(config))
    config.add_member("brien", "in the open", bind_dn="cn=O\\, Brien,o=x")
    config.add(MASTER, supplier("orv-slapdReplication", "cn=master", "cn=supplier"))
    config.add("cn=near,cn=replication,cn=configuration",
               supplier("orv-slapdSupplier", "near", "cn=near supplier")
               + [("orv-slapdMasterSuffix", "o=near")])
    config.add("cn=stray,cn=schemas,cn=configuration",
               [("objectClass", ["top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"]),
                ("cn", "stray"), ("orv-slapdAdminDN", "cn=stray"),
                ("orv-slapdAdminPW", "in the open"), ("orv-slapdAdminRole", "SchemaAdmin")])
    return module_instance.start()


def supplier(kind, name, bind_dn):
    return [("objectClass", ["top", "orv-slapdConfigEntry", kind]), ("cn", name.split("=")[-1]),
            ("orv-slapdMasterDN", bind_dn), ("orv-slapdMasterPW", "supplies")]


def ssha(algorithm, scheme, password):
    salt = os.urandom(16)
    digest = algorithm(password.encode() + salt).digest()
    return scheme + base64.b64encode(digest + salt).decode()


def ssha512(password):
    return ssha(hashlib.sha512, "{SSHA512}", password)


def pbkdf2(password):
    salt = os.urandom(16)
    derived = hashlib.pbkdf2_hmac("sha256", password.encode(), salt, 1000)
    text = [base64.b64encode(part).decode().rstrip("=") for part in (salt, derived)]
    return "{PBKDF2-SHA256}1000$" + "$".join(text)


def admin_password_as_stored(config):
    entries = clients.parse_ldif(config.read())
    return entries[clients.BASE]["orv-slapdAdminPW"][0].decode()


def search_code(instance, who, password):
    client = clients.connect(instance)
    if who is not None:
        client.simple_bind_s(who, password)
    try:
        return clients.code_of(clients.read, client, clients.BASE)
    finally:
        client.unbind_s()


@pytest.mark.parametrize("spelling", ["cn=root", "CN=ROOT", "cn = Root", "2.5.4.3=root",
                                      "cn=\\72oot", "commonName=root"])
def test_administrator_binds_under_every_spelling_of_its_name(people, spelling):
    assert clients.bind_code(people, spelling, people.password) == 0


@pytest.mark.parametrize("name, password", [
    ("clear", "in the open"), ("hashed", "salted"), ("ssha256", "salted 256"),
    ("ssha", "salted 1"), ("derived", "derived")])
def test_member_binds_with_a_password_stored_as(people, name, password):
    assert clients.bind_code(people, "cn=" + name, password) == 0
    assert clients.bind_code(people, "cn=" + name, password + "x") == 49


def test_member_with_a_comma_in_its_name_binds(people):
    assert clients.bind_code(people, "CN=o\\2c brien,O=X", "in the open") == 0


@pytest.mark.parametrize("who, password", [
    ("cn=root", "wrong"), ("cn=root", " "), ("cn=nobody", "wrong"), ("cn=clear", "In the open"),
    ("cn=unknown", "{ROT13}frperg"), ("cn=unknown", "secret"), ("cn=malformed", "{SSHA512}!!!!"),
    ("cn=hashed", "{SSHA512}"), ("dc=example,dc=com", "in the open")])
def test_wrong_credentials_are_answered_49(people, who, password):
    assert clients.bind_code(people, who, password) == 49


def test_stored_form_of_a_password_is_no_password(people):
    stored = admin_password_as_stored(people.config)
    assert clients.bind_code(people, "cn=root", stored) == 49


def test_sealed_password_copied_into_another_entry_matches_nothing(people):
    assert clients.bind_code(people, "cn=thief", people.password) == 49
    assert clients.bind_code(people, "cn=thief", admin_password_as_stored(people.config)) == 49


@pytest.mark.parametrize("who", [
    "cn=configuration", "cn=admingroup,cn=configuration", "CN = Digest , CN=Configuration",
    "cn=clear,cn=admingroup,cn=configuration", "cn=missing,cn=configuration", MASTER])
def test_nobody_binds_as_an_entry_of_the_configuration(people, who):
    for password in ["in the open", people.password, "supplies"]:
        assert clients.bind_code(people, who, password) == 49


def test_member_whose_name_lies_in_the_configuration_cannot_bind(people):
    assert clients.bind_code(people, "cn=digest,cn=configuration", "in the open") == 49


def test_name_that_two_members_claim_is_nobodys(people):
    assert clients.bind_code(people, "cn=twin", "twin password") == 49


def test_member_entry_outside_the_group_is_no_identity(people):
    assert clients.bind_code(people, "cn=stray", "in the open") == 49


@pytest.mark.parametrize("who", ["cn=root", "cn=nobody", "cn=digest,cn=configuration"])
def test_name_without_password_is_answered_53(people, who):
    assert clients.bind_code(people, who, "") == 53


def test_failed_bind_leaves_the_connection_anonymous(people):
    client = clients.bind(people)
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        client.simple_bind_s("cn=root", "wrong")
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.read(client, clients.BASE)


def test_anonymous_bind_takes_the_rights_away(people):
    client = clients.bind(people)
    client.simple_bind_s("", "")
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.read(client, clients.BASE)


def test_bind_with_a_name_that_is_no_dn_is_refused(people):
    assert clients.bind_code(people, "root", "wrong") in (34, 49)


def test_version_2_is_refused(people):
    client = clients.connect(people)
    client.protocol_version = ldap.VERSION2
    with pytest.raises(ldap.PROTOCOL_ERROR):
        client.simple_bind_s("cn=root", people.password)


def test_sasl_mechanism_that_is_not_offered_is_refused(people):
    client = clients.connect(people)
    with pytest.raises(ldap.AUTH_UNKNOWN):
        client.sasl_non_interactive_bind_s("EXTERNAL")


@pytest.mark.parametrize("scope", [ldap.SCOPE_BASE, ldap.SCOPE_ONELEVEL, ldap.SCOPE_SUBTREE])
def test_anonymous_search_is_answered_50(people, scope):
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.search(clients.connect(people), scope=scope)


def test_anonymous_learns_not_whether_an_entry_exists(people):
    client = clients.connect(people)
    for base in ["cn=audit,cn=log management,cn=configuration", "cn=missing,cn=configuration"]:
        with pytest.raises(ldap.INSUFFICIENT_ACCESS):
            clients.search(client, base)


@pytest.mark.parametrize("who", ["cn=supplier", "cn=near supplier"])
def test_supplier_binds_but_may_not_read_the_configuration(people, who):
    assert clients.bind_code(people, who, "supplies") == 0
    assert search_code(people, who, "supplies") == 50


def test_member_without_a_role_may_read(people):
    assert search_code(people, "cn=unassigned", "in the open") == 0


def test_no_member_binds_while_the_group_is_switched_off(instance):
    instance.config.add_member("alice", "in the open")
    instance.config.set(clients.BASE, "orv-slapdAdminGroupEnabled", "FALSE")
    instance.start()
    assert clients.bind_code(instance, "cn=alice", "in the open") == 49
    assert clients.bind_code(instance, "cn=root", instance.password) == 0


def test_member_added_by_hand_binds_at_once(server):
    assert clients.bind_code(server, "cn=alice", "in the open") == 49
    server.config.add_member("alice", "in the open")
    assert clients.bind_code(server, "cn=alice", "in the open") == 0


def test_example_member_of_the_default_configuration_needs_only_a_password(server):
    text = server.config.read()
    commented = b"# dn: cn=alice,CN=ADMINGROUP,CN=CONFIGURATION\n"
    start = text.index(commented)
    example, rest = text[start:].split(b"\n\n", 1)
    lines = [line[2:] for line in example.split(b"\n")]
    chosen = [b"orv-slapdAdminPW: chosen" if line.startswith(b"orv-slapdAdminPW:") else line
              for line in lines]
    assert chosen != lines
    # The line that was "#" alone separates the record from the comment above it.
    server.config.replace(text[:start].removesuffix(b"#\n") + b"\n" + b"\n".join(chosen) + b"\n\n"
                          + rest)
    assert clients.bind_code(server, "cn=alice", "chosen") == 0
    assert clients.bind_code(server, clients.ADMINISTRATOR, server.password) == 0


def test_member_removed_by_hand_is_gone_at_once(instance):
    instance.config.add_member("alice", "in the open")
    instance.start()
    assert clients.bind_code(instance, "cn=alice", "in the open") == 0
    instance.config.remove("cn=alice,cn=admingroup,cn=configuration")
    assert clients.bind_code(instance, "cn=alice", "in the open") == 49


def test_connection_of_a_member_removed_by_hand_ends_without_anybody_binding(instance):
    instance.config.add_member("alice", "in the open")
    instance.start()
    with wire.Wire(instance) as alice:
        assert alice.bind("cn=alice", "in the open") == 0
        instance.config.remove("cn=alice,cn=admingroup,cn=configuration")
        notice = alice.answer()
        assert notice is not None and notice.is_notice


def test_connection_of_a_member_ends_when_what_kept_its_removal_from_being_read_has_passed(
        instance):
    instance.config.add_member("alice", "in the open")
    instance.start()
    with wire.Wire(instance) as alice:
        assert alice.bind("cn=alice", "in the open") == 0
        os.chmod(instance.key_stash, 0o640)  # refused: others may read it
        instance.config.remove("cn=alice,cn=admingroup,cn=configuration")
        assert instance.stderr.wait_for(re.compile("the identities stay as they were").search)
        os.chmod(instance.key_stash, 0o600)
        notice = alice.answer()
        assert notice is not None and notice.is_notice


def test_administrator_cannot_bind_under_another_key_than_the_sealing_one(instance):
    instance.key_stash.write_text("orv-key-1 " + "5a" * 32 + "\n")
    instance.start()
    assert clients.bind_code(instance, "cn=root", instance.password) == 49
    assert instance.stderr.wait_for(
        re.compile("warning CN=CONFIGURATION: orv-slapdAdminPW does not open with the key").search)


def test_server_without_a_key_says_whose_password_it_cannot_open(instance):
    command = [str(programs.orvd()), "--config", str(instance.config.path), "--check"]
    done = subprocess.run(command, check=True, text=True, stdout=subprocess.PIPE,
                          stderr=subprocess.PIPE, timeout=programs.DEADLINE)
    assert "CN=CONFIGURATION: orv-slapdAdminPW is sealed, and no key stash is named" in done.stderr
