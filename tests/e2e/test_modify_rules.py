"""What no modification may make of the configuration, whoever sends it: each rule with its code, the
text that the client gets, and a file that stays as it was."""

import ldap
import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import (GROUP, LOGS, PASSWORD, add, added, deleted, member, modify, refusal,
                             replaced)

TOP = "cn=configuration"
POLICY = "cn=pwdpolicy admin," + TOP
PROXY = "cn=proxydb,cn=proxy backends,cn=orv directory,cn=schemas," + TOP
NEW_PASSWORD = "Qm4&wt8?Lb6%"


@pytest.fixture(name="refuse")
def refuse_fixture(server, root):
    """The code of a modify by the primary administrator that has to change nothing."""
    def refuse(dn, *modifications):
        before = server.config.read()
        code = modify(root, dn, *modifications)
        assert server.config.read() == before
        return code
    return refuse


def stored(instance, dn, name):
    return clients.parse_ldif(instance.config.read())[dn].get(name, [])


# ---- listening addresses

@pytest.mark.parametrize("address", ["192.0.2.1", "2001:db8::1", "0.0.0.0", "::", "localhost"])
def test_listening_address_that_the_host_lacks_is_refused_and_named(server, root, address):
    before = server.config.read()
    assert refusal(root, TOP, added("orv-slapdIpAddress", address)) == (
        19, "IP address %s is not defined for this system." % address)
    assert server.config.read() == before


def test_address_that_left_the_host_bars_all_changes_of_its_entry_until_it_is_removed(instance):
    instance.config.set(TOP, "orv-slapdIpAddress", "127.0.0.1", "192.0.2.1")
    root = clients.bind(instance.start("--address", "127.0.0.1"))
    assert modify(root, TOP, replaced("orv-slapdSizeLimit", "5")) == 19
    assert modify(root, TOP, deleted("orv-slapdIpAddress", "192.0.2.1"),
                  replaced("orv-slapdSizeLimit", "5")) == 0
    root.unbind_s()


# ---- the audit log's file

@pytest.mark.parametrize("way", ["itself", "link", "dots", "letter case"])
def test_no_other_log_is_pointed_at_the_file_of_the_audit_log(server, root, refuse, tmp_path, way):
    assert add(root, *changes.container("written down")) == 0  # so that the file is there
    file = server.directory / "log" / "audit.log"
    assert file.exists()
    link = tmp_path / "link"
    link.symlink_to(file)
    target = {"itself": file, "link": link, "letter case": str(file).replace("audit", "AUDIT"),
              "dots": server.directory / "log" / ".." / "log" / "audit.log"}[way]
    for log in ("cn=access,", "cn=default,", "cn=admin audit,"):
        assert refuse(log + LOGS, replaced("orv-slapdLog", str(target))) == 53


def test_audit_log_itself_may_move(server, root):
    moved = server.directory / "log" / "moved.log"
    assert modify(root, "cn=audit," + LOGS, replaced("orv-slapdLog", str(moved))) == 0
    assert add(root, *changes.container("written down")) == 0
    assert b"written down" in moved.read_bytes()


# ---- how passwords are stored

@pytest.mark.parametrize("method, answer", [
    ("rot13", (21, "orv-slapdPwEncryption value is not one of the supported values.")),
    ("none", (53, "requested orv-slapdPwEncryption value is not allowed by current configuration."))])
def test_password_encryption_that_is_unknown_or_forbidden_is_refused(server, root, method, answer):
    before = server.config.read()
    assert refusal(root, TOP, replaced("orv-slapdPwEncryption", method)) == answer
    assert server.config.read() == before


# ---- roles

def test_last_roles_taken_away_by_value_leave_no_admin(server, root):
    dn, attributes = member("carol", roles=["AuditAdmin", "SchemaAdmin"])
    assert add(root, dn, attributes) == 0
    assert modify(root, dn, deleted("orv-slapdAdminRole", "schemaadmin", "AuditAdmin")) == 0
    assert stored(server, dn, "orv-slapdAdminRole") == [b"NoAdmin"]


def test_roles_are_not_taken_away_as_a_whole_and_unknown_ones_not_given(root, refuse):
    dn, attributes = member("carol", roles=["AuditAdmin", "SchemaAdmin"])
    assert add(root, dn, attributes) == 0
    assert refuse(dn, deleted("orv-slapdAdminRole")) == 65
    assert refuse(dn, replaced("orv-slapdAdminRole")) == 65
    assert refuse(dn, deleted("orv-slapdAdminRole", "PasswordAdmin")) == 16
    assert refuse(dn, added("orv-slapdAdminRole", "Emperor")) == 80
    assert refuse(dn, replaced("orv-slapdAdminRole", "Emperor")) == 80


def test_delete_of_roles_that_are_not_the_members_takes_none(root, refuse):
    dn, attributes = member("carol", roles=["AuditAdmin", "SchemaAdmin"])
    attributes["description"] = ["x"]
    assert add(root, dn, attributes) == 0
    others = deleted("orv-slapdAdminRole", "PasswordAdmin", "SchemaAdmin")
    assert refuse(dn, others) == 16
    assert refuse(dn, others, deleted("description", "x")) == 53
    assert refuse(dn, deleted("description", "x"), others) == 16


# ---- identities

def test_second_identity_with_the_same_name_is_refused(root, refuse):
    supplier, attributes = changes.supplier("near", bind_dn="cn=near")
    assert add(root, supplier, attributes) == 0
    for name in ("carol", "dave"):
        assert add(root, *member(name, KrbAdminDN="orv-kn=%s@EXAMPLE.COM" % name,
                                 DigestAdminUser=name)) == 0
    carol = "cn=carol," + GROUP
    for taken in ("cn=dave", "CN = Near", "cn=root"):
        assert refuse(carol, replaced("orv-slapdAdminDN", taken)) == 68, taken
    assert refuse(TOP, replaced("orv-slapdAdminDN", "cn=near")) == 68
    assert refuse(supplier, replaced("orv-slapdMasterDN", "CN=Dave")) == 68
    assert refuse(carol, replaced("orv-slapdKrbAdminDN", "ORV-KN=DAVE@EXAMPLE.COM")) == 68
    assert refuse(carol, replaced("orv-slapdKrbAdminDN", "cn=carol@EXAMPLE.COM")) == 80
    assert refuse(carol, replaced("orv-slapdDigestAdminUser", "dave")) == 68
    assert refuse("cn=digest," + TOP, added("orv-slapdDigestAdminUser", "dave")) == 68


def test_name_inside_the_configuration_is_refused_since_nobody_could_bind_with_it(server, root,
                                                                                  refuse):
    supplier, attributes = changes.supplier("near")
    assert add(root, supplier, attributes) == 0
    assert add(root, *member("carol")) == 0
    for name in ("cn=foo,cn=configuration", "CN = Configuration", "cn=x,2.5.4.3=\\43onfiguration"):
        assert refuse(TOP, replaced("orv-slapdAdminDN", name)) == 19, name
        assert refuse("cn=carol," + GROUP, replaced("orv-slapdAdminDN", name)) == 19
        assert refuse(supplier, replaced("orv-slapdMasterDN", name)) == 19
        assert add(root, *member("dave", bind_dn=name)) == 19
        assert add(root, *changes.supplier("far", bind_dn=name)) == 19
    _, text = refusal(root, TOP, replaced("orv-slapdAdminDN", name))
    assert "orv-slapdAdminDN" in text and "CN=CONFIGURATION" in text
    clients.bind(server).unbind_s()
    clients.bind(server, "cn=carol", PASSWORD).unbind_s()


def test_kerberos_identity_of_the_administrator_is_held_to_the_same(root, refuse):
    assert add(root, *member("dave", KrbAdminDN="orv-kn=dave@EXAMPLE.COM")) == 0
    dn = "cn=kerberos," + TOP
    assert add(root, dn, {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdKerberos"],
                          "cn": ["kerberos"], "orv-slapdKrbAdminDN": ["orv-kn=root@EXAMPLE.COM"]
                          }) == 0
    assert refuse(dn, replaced("orv-slapdKrbAdminDN", "orv-kn=dave@EXAMPLE.COM")) == 68
    assert refuse(dn, replaced("orv-slapdKrbAdminDN", "cn=root@EXAMPLE.COM")) == 80
    assert modify(root, dn, replaced("orv-slapdKrbAdminDN", "orv-kerberosName=other@EXAMPLE.COM")
                  ) == 0


def test_names_of_a_split_proxy_are_letters_and_digits_and_nobody_elses(root, refuse):
    for name in ("part1", "part2"):
        assert add(root, "cn=%s,%s" % (name, PROXY), {
            "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdProxySplit"], "cn": [name],
            "orv-slapdProxySplitName": [name]}) == 0
    assert refuse("cn=part1," + PROXY, replaced("orv-slapdProxySplitName", "part-1")) == 21
    assert refuse("cn=part1," + PROXY, replaced("orv-slapdProxySplitName", "part2")) == 68
    assert modify(root, "cn=part1," + PROXY, replaced("orv-slapdProxySplitName", "PART2")) == 0


# ---- passwords

@pytest.mark.parametrize("password", ["short1", "onlyletterswithoutany", "0123456789012345",
                                      "aaaaaaaaaaaa11", PASSWORD])
def test_new_password_against_the_policy_is_refused(root, refuse, password):
    dn, attributes = member("carol")
    assert add(root, dn, attributes) == 0
    assert refuse(dn, replaced("orv-slapdAdminPW", password)) == 19
    assert modify(root, dn, replaced("orv-slapdAdminPW", NEW_PASSWORD)) == 0


@pytest.mark.parametrize("changed", [
    [replaced("passwordMinAlphaChars", "7"), replaced("passwordMinOtherChars", "6")],
    [replaced("pwdMinLength", "3")],
    [replaced("passwordMinDiffChars", "13")],
    [replaced("pwdMaxFailure", "0")],
    [replaced("pwdMinLength", "257")]])
def test_settings_of_the_policy_that_contradict_one_another_are_refused(refuse, changed):
    assert refuse(POLICY, *changed) == 19


def test_policy_is_in_force_with_the_next_password(root, refuse):
    dn, attributes = member("carol")
    assert add(root, dn, attributes) == 0
    assert modify(root, POLICY, replaced("pwdMinLength", "20")) == 0
    assert refuse(dn, replaced("orv-slapdAdminPW", NEW_PASSWORD)) == 19
    assert modify(root, POLICY, replaced("orv-slapdAdminPolicyEnabled", "FALSE")) == 0
    assert modify(root, dn, replaced("orv-slapdAdminPW", "short")) == 0


def test_policy_that_contradicts_itself_is_refused_while_it_is_off_too(server, root, refuse):
    """Else it would be switched on with success, and the one before would go on to hold."""
    enabled = "orv-slapdAdminPolicyEnabled"
    assert modify(root, POLICY, replaced(enabled, "FALSE")) == 0
    number = changes.numbers_of_classes()["pwdMinLength"]
    for change in ([replaced("pwdMinLength", "3")], [replaced(number, "3")],
                   [deleted("pwdMinLength", "12"), added("PWDMINLENGTH", "3")],
                   [replaced("passwordMinAlphaChars", "7"), replaced("passwordMinOtherChars", "6")],
                   [replaced("pwdMinLength", "257")], [replaced("pwdMinLength", "99999999999")],
                   [replaced("pwdMaxFailure", "0"), replaced(enabled, "TRUE")]):
        assert refuse(POLICY, *change) == 19, change
    code, text = refusal(root, POLICY, replaced("pwdMinLength", "3"))
    assert code == 19
    assert "passwordMinAlphaChars and passwordMinOtherChars together exceed pwdMinLength" in text
    assert refuse(POLICY, replaced("pwdMinLength", "ten")) == 21
    # It is prepared while it is off, in one request what belongs together, and then holds.
    assert modify(root, POLICY, replaced("pwdMinLength", "3"),
                  replaced("passwordMinAlphaChars", "1")) == 0
    assert add(root, *member("carol", password="a")) == 0
    assert modify(root, POLICY, replaced(enabled, "TRUE")) == 0
    assert add(root, *member("dave", password="a")) == 19
    assert add(root, *member("dave", password="a--")) == 0


def test_settings_that_are_taken_from_the_policy_leave_none_that_contradict(root, refuse):
    """What is not there has its default."""
    assert modify(root, POLICY, replaced("pwdMinLength", "30"),
                  replaced("passwordMinAlphaChars", "20")) == 0
    assert refuse(POLICY, deleted("pwdMinLength")) == 19
    assert refuse(POLICY, deleted("pwdMinLength", "30")) == 19
    assert refuse(POLICY, replaced("pwdMinLength")) == 19
    assert modify(root, POLICY, deleted("pwdMinLength"), deleted("passwordMinAlphaChars")) == 0
    assert modify(root, POLICY, replaced("description", "defaults")) == 0


def test_policy_that_contradicts_itself_is_not_added(server, root):
    assert changes.delete(root, POLICY) == 0
    policy = {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdAdminPolicy"],
              "cn": ["PwdPolicy Admin"], "orv-slapdAdminPolicyEnabled": ["FALSE"],
              "pwdMinLength": ["3"]}
    before = server.config.read()
    assert add(root, POLICY, policy) == 19
    assert server.config.read() == before
    policy["passwordMinAlphaChars"] = ["1"]
    assert add(root, POLICY, policy) == 0
    assert add(root, *member("carol", password="a")) == 0


# ---- pass-through entries

def test_pass_through_entry_is_held_to_the_rules_of_its_adding(root, refuse):
    for name in ("first", "second"):
        assert add(root, *changes.pass_through(name, "o=" + name)) == 0
    dn = "cn=first,cn=passthrough authentication," + TOP
    assert refuse(dn, replaced("orv-slapdPtaURL", "no url")) == 21
    assert refuse(dn, added("orv-slapdPtaSubtree", "ou=x,o=first")) == 19
    assert refuse(dn, added("orv-slapdPtaSubtree", "ou=x, O=Second")) == 19
    assert refuse(dn, replaced("orv-slapdPtaSubtree", "cn=localhost")) == 19
    assert refuse(dn, replaced("orv-slapdPtaAttrMapping", "nothing")) == 21
    assert refuse(dn, deleted("orv-slapdPtaSubtree")) == 65
    assert modify(root, dn, replaced("orv-slapdPtaSubtree", "o=first", "o=third")) == 0


# ---- what is in force

def test_refused_change_leaves_in_force_what_was(server, root, refuse):
    entries = len(clients.search(root))
    assert refuse(TOP, replaced("orv-slapdSizeLimit", "2"),
                  replaced("orv-slapdIpAddress", "192.0.2.1")) == 19
    assert len(clients.search(root)) == entries
    dn, attributes = member("carol", roles=["AuditAdmin", "SchemaAdmin"])
    assert add(root, dn, attributes) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert refuse(dn, replaced("orv-slapdAdminPW", NEW_PASSWORD),
                  replaced("orv-slapdAdminDN", "cn=root")) == 68
    assert refuse(dn, replaced("orv-slapdAdminRole", "NoAdmin"),
                  replaced("orv-slapdAdminDN", "cn=root")) == 68
    assert clients.search(carol)
    assert modify(carol, "cn=audit," + LOGS, replaced("description", "x")) == 0
    clients.bind(server, "cn=carol", PASSWORD).unbind_s()
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        clients.bind(server, "cn=carol", NEW_PASSWORD)
    assert refuse(POLICY, replaced("pwdMinLength", "30"), replaced("pwdMaxFailure", "0")) == 19
    assert add(root, *member("dave")) == 0
    carol.unbind_s()


# ---- entries of others

def test_replication_context_and_missing_entry_are_answered(root, refuse):
    assert refuse("cn=schemas," + TOP, added("objectClass", "orv-replicationContext")) == 92
    assert refuse("cn=nowhere," + TOP, replaced("description", "x")) == 32
    with pytest.raises(ldap.NO_SUCH_OBJECT):
        clients.read(root, "cn=nowhere," + TOP)
