"""Entries are added and deleted over LDAP, under the rules of the configuration."""

import subprocess

import ldap
import pytest

from orv_e2e import changes, clients, programs
from orv_e2e.changes import PASSWORD, add, delete, member

DEFAULT_ROLES = {b"DirDataAdmin", b"PasswordAdmin", b"SchemaAdmin", b"ServerConfigGroupMember",
                 b"ServerStartStopAdmin"}


def bind_code(instance, who, password=PASSWORD):
    return clients.bind_code(instance, who, password)


def ldif(tmp_path, dn, attributes):
    file = tmp_path / "new.ldif"
    lines = ["dn: " + dn]
    lines += ["%s: %s" % (name, value) for name, values in attributes.items() for value in values]
    file.write_text("\n".join(lines) + "\n")
    return str(file)


# ---- what a user sees

def test_member_added_with_ldapadd_has_the_default_roles_and_binds_at_once(server, tmp_path):
    dn, attributes = member("carol")
    done = clients.command("ldapadd", server, "-f", ldif(tmp_path, dn, attributes))
    assert done.returncode == 0, done.stderr
    stored = clients.parse_ldif(server.config.read())[dn]
    assert set(stored["orv-slapdAdminRole"]) == DEFAULT_ROLES
    assert PASSWORD.encode() not in server.config.read()
    assert bind_code(server, "cn=carol") == 0
    assert bind_code(server, "CN = Carol") == 0
    assert bind_code(server, "cn=carol", PASSWORD + "x") == 49


def test_new_member_may_do_what_its_roles_allow_and_no_more(server, root):
    assert add(root, *member("carol")) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert add(carol, *changes.container("by carol")) == 0
    assert delete(carol, "cn=by carol," + changes.PLACE) == 0
    assert delete(carol, "cn=audit," + changes.LOGS) == 50  # takes AuditAdmin
    assert add(carol, *member("dave")) == 50
    carol.unbind_s()


def test_entry_deleted_with_ldapdelete_is_gone_from_the_file(server, root):
    dn, attributes = changes.container("short lived")
    before = server.config.read()
    assert add(root, dn, attributes) == 0
    done = clients.command("ldapdelete", server, dn)
    assert done.returncode == 0, done.stderr
    assert server.config.read() == before
    assert delete(root, dn) == 32


def test_change_shows_as_the_touched_entry_and_nothing_else(server, root):
    before = server.config.read()
    dn, attributes = changes.container("quiet", description=["one", "two"])
    assert add(root, dn, attributes) == 0
    after = server.config.read()
    removed, added = changes.difference(before, after)
    assert removed == []
    assert [line for line in added if line] == [
        b"dn: " + dn.encode(), b"objectClass: top", b"objectClass: container", b"cn: quiet",
        b"description: one", b"description: two"]
    assert (server.directory / "config.ldif.save").read_bytes() == before
    assert delete(root, "cn=digest,cn=configuration") == 0
    removed, added = changes.difference(after, server.config.read())
    assert added == []
    assert [line for line in removed if line and not line.startswith(b"#")] == [
        b"dn: CN=DIGEST,CN=CONFIGURATION", b"objectClass: top",
        b"objectClass: orv-slapdConfigEntry", b"objectClass: orv-slapdDigest", b"cn: Digest"]


def test_value_of_the_name_that_the_entry_lacks_is_completed(server, root):
    dn = "cn=Completed,cn=schemas,cn=configuration"
    assert add(root, dn, {"objectClass": ["top", "container"]}) == 0
    assert clients.read(root, dn)["cn"] == [b"Completed"]
    dn = "cn=O  Brien,cn=schemas,cn=configuration"
    assert add(root, dn, {"objectClass": ["top", "container"], "cn": ["o brien"]}) == 0
    assert clients.read(root, dn)["cn"] == [b"o brien"]


@pytest.mark.parametrize("dn, code", [
    ("cn=configuration", 66), (changes.LOGS, 66), ("cn=nobody,cn=configuration", 32),
    ("cn=x,dc=example", 32), ("", 53), ("no dn", 34),
    ("cn=ConfigDB,cn=Config Backends,cn=ORV Directory,cn=Schemas,cn=Configuration", 53)])
def test_delete_of_what_cannot_be_deleted_is_answered(server, root, dn, code):
    before = server.config.read()
    assert delete(root, dn) == code
    assert server.config.read() == before


@pytest.mark.parametrize("dn, code", [
    ("cn=digest,cn=configuration", 68), ("CN = Digest, CN=\\43onfiguration", 68),
    ("2.5.4.3=digest,cn=configuration", 68), ("cn=x,cn=nowhere,cn=configuration", 32),
    ("cn=x,dc=example", 32), ("", 53), ("no dn", 34)])
def test_add_where_nothing_can_be_added_is_answered(server, root, dn, code):
    before = server.config.read()
    assert add(root, dn, {"objectClass": ["top", "container"], "cn": ["x", "digest"]}) == code
    assert server.config.read() == before


# ---- identities are unique

@pytest.mark.parametrize("spelling", ["cn=carol", "CN=CAROL", "cn = Carol", "2.5.4.3=carol",
                                      "cn=\\63arol", "commonName=carol", "cn=#04056361726F6C"])
def test_second_identity_with_the_same_bind_dn_is_refused(server, root, spelling):
    assert add(root, *member("carol")) == 0
    before = server.config.read()
    assert add(root, *member("twin", bind_dn=spelling)) == 68
    assert add(root, *changes.supplier("twin", bind_dn=spelling)) == 68
    assert server.config.read() == before


@pytest.mark.parametrize("spelling", ["cn=root", "CN = Root", "cn=\\72oot"])
def test_identity_with_the_dn_of_the_primary_administrator_is_refused(server, root, spelling):
    assert add(root, *member("twin", bind_dn=spelling)) == 68


def test_member_with_the_dn_of_a_supplier_is_refused(server, root):
    assert add(root, *changes.supplier("near", bind_dn="cn=near")) == 0
    assert add(root, *member("twin", bind_dn="CN=Near")) == 68


@pytest.mark.parametrize("dn", ["", "  "])
def test_empty_dn_is_nobodys(server, root, dn):
    assert add(root, *member("empty", bind_dn=" ")) == 21
    made, attributes = member("empty")
    attributes["orv-slapdAdminDN"] = [dn]
    assert add(root, made, attributes) == 21
    made, attributes = changes.supplier("empty")
    attributes["orv-slapdMasterDN"] = [dn]
    assert add(root, made, attributes) == 21


@pytest.mark.parametrize("spelling, code", [
    ("orv-kn=admin@EXAMPLE.COM", 68), ("orv-kn=ADMIN@example.com", 68),
    ("orv-kerberosName=admin@EXAMPLE.COM", 68), ("ORV-KERBEROSNAME=Admin@Example.Com", 68),
    ("orv-kn= admin@EXAMPLE.COM", 21), ("orv-kn =admin@EXAMPLE.COM", 21),
    ("orv-kn=\\61dmin@EXAMPLE.COM", 21), ("orv-kn=#0405", 21), ("orv-kn=", 21), ("admin", 21),
    ("cn=admin@EXAMPLE.COM", 80), ("orv-kn=other@EXAMPLE.COM", 0)])
def test_second_kerberos_identity_is_refused_and_other_spellings_are_no_syntax(
        server, root, spelling, code):
    assert add(root, *member("first", KrbAdminDN="orv-kn=admin@EXAMPLE.COM")) == 0
    assert add(root, *member("second", KrbAdminDN=spelling)) == code


@pytest.mark.parametrize("name, code", [("digester", 68), ("Digester", 0), (" digester", 21),
                                        ("digester ", 21), ("\uff44igester", 21),
                                        ("dig\u00adester", 21), ("", 21)])
def test_second_digest_name_is_refused_and_unprepared_ones_are_no_syntax(
        server, root, name, code):
    assert add(root, *member("first", DigestAdminUser="digester")) == 0
    assert add(root, *member("second", DigestAdminUser=name)) == code


def test_overlapping_pass_through_entries_are_refused(server, root):
    assert add(root, *changes.pass_through("one", "ou=a,o=example")) == 0
    assert add(root, *changes.pass_through("same", "OU = A, O=Example")) == 19
    assert add(root, *changes.pass_through("below", "cn=x,ou=a,o=example")) == 19
    assert add(root, *changes.pass_through("above", "o=example")) == 19
    assert add(root, *changes.pass_through("itself", "o=two", "ou=x,o=two")) == 19
    assert add(root, *changes.pass_through("reserved", "cn=configuration")) == 19
    assert add(root, *changes.pass_through("url", "o=three", url="nonsense")) == 21
    assert add(root, *changes.pass_through("other", "ou=b,o=example")) == 0


@pytest.mark.parametrize("password", ["short", "aaaaaaaaaaaaaaaaaaa1!", "onlylettersinthis",
                                      "1234567890!?", ""])
def test_password_against_the_policy_is_refused(server, root, password):
    before = server.config.read()
    assert add(root, *member("weak", password=password)) in (19, 21)
    assert server.config.read() == before


def test_unknown_role_is_refused_and_an_entry_without_its_mandatory_attribute_too(server, root):
    assert add(root, *member("odd", roles=["Emperor"])) == 80
    dn, attributes = member("odd")
    del attributes["orv-slapdAdminDN"]
    assert add(root, dn, attributes) == 65


# ---- changes of who may do what

def test_deleted_member_is_disconnected_and_binds_no_more(server, root):
    assert add(root, *member("carol")) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert delete(root, "cn=carol," + changes.GROUP) == 0
    with pytest.raises(ldap.LDAPError):
        clients.read(carol, clients.BASE)
    assert bind_code(server, "cn=carol") == 49


def test_other_identities_stay_connected_when_a_member_goes(server, root):
    assert add(root, *member("carol")) == 0
    assert add(root, *member("dave")) == 0
    dave = clients.bind(server, "cn=dave", PASSWORD)
    assert delete(root, "cn=carol," + changes.GROUP) == 0
    assert clients.read(dave, clients.BASE)
    dave.unbind_s()


def test_supplier_binds_at_once_and_is_gone_when_its_entry_is(server, root):
    dn, attributes = changes.supplier("near", bind_dn="cn=near")
    assert add(root, dn, attributes) == 0
    assert bind_code(server, "cn=near") == 0
    assert delete(root, dn) == 0
    assert bind_code(server, "cn=near") == 49


def test_deleting_the_access_log_entry_ends_the_access_log(server, root):
    assert delete(root, "cn=access," + changes.LOGS) == 0
    server.stderr.wait_for(lambda line: "settings taken over" in line)
    size = server.access_log.stat().st_size
    clients.read(root, clients.BASE)
    assert add(root, *changes.container("unlogged")) == 0
    assert server.access_log.stat().st_size == size


def test_policy_stays_in_force_when_its_entry_is_deleted(server, root):
    assert delete(root, "cn=pwdpolicy admin,cn=configuration") == 0
    assert add(root, *member("weak", password="short")) == 19


# ---- the server's own guards

def test_only_the_primary_administrator_deletes_and_adds_the_password_policy(server, root):
    dn = "cn=pwdpolicy admin,cn=configuration"
    policy = clients.read(root, dn)
    assert add(root, *member("carol", roles=["ServerConfigGroupMember"])) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert delete(carol, dn) == 50
    assert delete(carol, "CN = PwdPolicy\\20Admin, 2.5.4.3=configuration") == 50
    assert delete(root, dn) == 0
    assert add(carol, dn, list(policy.items())) == 50
    assert add(root, dn, list(policy.items())) == 0
    carol.unbind_s()


def test_nobody_deletes_the_container_of_pass_through_entries(server, root):
    assert delete(root, "cn=passthrough authentication,cn=configuration") == 53


@pytest.mark.parametrize("level, code", [("loud", 19), ("infos", 19), ("", 19), ("Debug", 0)])
def test_log_level_that_would_stop_the_next_start_is_refused(server, root, level, code):
    dn = "cn=audit," + changes.LOGS
    entry = clients.read(root, dn)
    assert delete(root, dn) == 0
    entry["orv-slapdLogLevel"] = [level.encode()]
    assert add(root, dn, list(entry.items())) == code
    server.stop()
    server.start()


def test_there_is_one_supplier_of_the_whole_server(server, root):
    assert add(root, *changes.supplier("second", kind="orv-slapdReplication")) == 53
    assert add(root, *changes.supplier("master server", kind="orv-slapdReplication",
                                       dn="cn=master server,cn=configuration")) == 0


def test_tools_agree_with_the_file_after_changes(server, root):
    assert add(root, *member("carol")) == 0
    assert add(root, *changes.supplier("near")) == 0
    assert delete(root, "cn=digest,cn=configuration") == 0
    done = subprocess.run([str(programs.orvcfg()), "check", str(server.config.path), "--key-stash",
                           str(server.key_stash)], stdout=subprocess.PIPE, check=False,
                          timeout=programs.DEADLINE)
    assert done.returncode == 0, done.stdout
