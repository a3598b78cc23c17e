"""What a client hears of a change that is refused: a code, and a text only where a rule has one."""

import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import (GROUP, LOGS, PASSWORD, add, added, deleted, member, modify, refusal,
                             replaced)

TOP = "cn=configuration"
POLICY = "cn=pwdpolicy admin," + TOP
CAROL = "cn=carol," + GROUP
DEFAULT_AUDIT_LOG = "/var/ldap/V6.0/audit.log"


@pytest.fixture(name="answer")
def answer_fixture(server, root):
    """The answer to a modify by the primary administrator that has to change nothing."""
    def answer(dn, *modifications):
        before = server.config.read()
        found = refusal(root, dn, *modifications)
        assert server.config.read() == before
        return found
    return answer


def test_refused_deletes_carry_no_text(server, root):
    assert add(root, *member("carol", roles=["ServerConfigGroupMember"])) == 0
    assert add(root, *changes.supplier("master server", kind="orv-slapdReplication",
                                       dn="cn=master server," + TOP)) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    before = server.config.read()
    backends = "cn=config backends,cn=orv directory,cn=schemas," + TOP
    for name in ("cn=configdb,", "CN=ConfigDB,", "cn=\\63onfigdb,"):
        assert clients.answer_of(root.delete_s, name + backends) == (53, "")
        assert clients.answer_of(carol.delete_s, name + backends) == (53, "")
    assert clients.answer_of(root.delete_s, "cn=nowhere," + TOP) == (32, "")
    assert clients.answer_of(root.delete_s, GROUP) == (66, "")
    for dn in (GROUP, CAROL, "cn=digest," + TOP, "cn=audit," + LOGS, "cn=master server," + TOP):
        assert clients.answer_of(carol.delete_s, dn) == (50, ""), dn
    assert server.config.read() == before
    assert clients.answer_of(carol.delete_s, "cn=replication," + TOP) in [(0, ""), (66, "")]


def test_changes_of_a_file_that_cannot_be_read_are_answered_1_each_time(server, root):
    good = server.config.read()
    server.config.replace(good + b"\nnonsense\n")
    for _ in range(2):
        assert add(root, *changes.container("new")) == 1
        assert clients.answer_of(root.delete_s, "cn=digest," + TOP) == (1, "")
        assert refusal(root, TOP, replaced("description", "x")) == (1, "")
    assert server.config.read() == good + b"\nnonsense\n"
    server.config.replace(good)
    assert modify(root, TOP, replaced("description", "x")) == 0


def test_refused_modifies_carry_no_text(server, root, answer):
    for name in ("carol", "dave"):
        assert add(root, *member(name, DigestAdminUser=name, KrbAdminDN="orv-kn=%s@R" % name)) == 0
    near, supplier = changes.supplier("near", bind_dn="cn=near")
    assert add(root, near, supplier) == 0
    log = "cn=default," + LOGS
    refused = [
        (TOP, replaced("orv-slapdAdminDN", "cn=dave"), 68),
        (CAROL, replaced("orv-slapdAdminDN", "CN = Root"), 68),
        (CAROL, replaced("orv-slapdKrbAdminDN", "orv-kn=dave@R"), 68),
        (CAROL, replaced("orv-slapdKrbAdminDN", "cn=carol@R"), 80),
        (CAROL, replaced("orv-slapdDigestAdminUser", "dave"), 68),
        (CAROL, added("orv-slapdAdminRole", "Emperor"), 80),
        (CAROL, deleted("orv-slapdAdminRole", "AuditAdmin"), 16),
        (CAROL, replaced("orv-slapdAdminPW", "short"), 19),
        (near, replaced("orv-slapdMasterDN", "CN=Carol"), 68),
        (POLICY, replaced("pwdMaxFailure", "0"), 19),
        (log, replaced("orv-slapdLog", str(server.directory / "log" / "audit.log")), 53)]
    for dn, modification, code in refused:
        assert answer(dn, modification) == (code, ""), (dn, modification)


def test_replace_by_nothing_removes_no_identity(root, answer):
    dn, attributes = member("carol", DigestAdminUser="carol", KrbAdminDN="orv-kn=carol@R")
    assert add(root, dn, attributes) == 0
    near, supplier = changes.supplier("near")
    assert add(root, near, supplier) == 0
    digest = "cn=digest," + TOP
    assert modify(root, digest, added("orv-slapdDigestAdminUser", "root")) == 0
    assert answer(digest, replaced("orv-slapdDigestAdminUser"))[0] == 80
    assert answer(TOP, replaced("orv-slapdPwEncryption"))[0] == 21
    assert answer(dn, replaced("orv-slapdAdminPW"))[0] == 90
    assert answer(near, replaced("orv-slapdMasterDN"))[0] in (65, 80)
    # A delete takes away what nothing asks for.
    assert modify(root, digest, deleted("orv-slapdDigestAdminUser")) == 0
    assert modify(root, dn, deleted("orv-slapdKrbAdminDN")) == 0
    assert modify(root, dn, deleted("orv-slapdAdminPW")) == 0
    assert modify(root, TOP, deleted("orv-slapdPwEncryption")) == 0


def test_member_changes_its_own_password_in_one_modification_and_nothing_else(server, root):
    for name in ("carol", "dave"):
        assert add(root, *member(name, roles=["NoAdmin"])) == 0
    new = replaced("orv-slapdAdminPW", "Qm4&wt8?Lb6%")
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert refusal(carol, "cn=dave," + GROUP, new) == (50, "")
    assert refusal(carol, CAROL, new, replaced("description", "x")) == (50, "")
    assert refusal(carol, CAROL, replaced("orv-slapdDigestAdminUser", "carol")) == (50, "")
    assert refusal(carol, GROUP, replaced("description", "x")) == (50, "")
    assert refusal(carol, TOP, replaced("orv-slapdSizeLimit", "5")) == (50, "")
    assert refusal(carol, CAROL, new) == (0, "")


def test_member_may_change_the_top_entry_but_for_the_administrators_settings(server, root):
    assert add(root, *member("carol", roles=["ServerConfigGroupMember"])) == 0
    carol = clients.bind(server, "cn=carol", PASSWORD)
    for setting in (replaced("orv-slapdAdminDN", "cn=carol's"), deleted("orv-slapdAdminPW"),
                    replaced("orv-slapdAdminGroupEnabled", "TRUE")):
        assert refusal(carol, TOP, setting) == (50, "")
        assert refusal(carol, TOP, replaced("description", "x"), setting) == (50, "")
    assert refusal(carol, POLICY, replaced("pwdMinLength", "12")) == (50, "")
    assert refusal(carol, TOP, replaced("orv-slapdSizeLimit", "5000")) == (0, "")


# ---- listening addresses

def test_first_address_that_the_host_lacks_is_the_one_that_is_named(answer, root):
    assert answer(TOP, replaced("orv-slapdIpAddress", "127.0.0.1", "192.0.2.7", "192.0.2.8")) == (
        19, "IP address 192.0.2.7 is not defined for this system.")
    assert modify(root, TOP, replaced("orv-slapdIpAddress", "127.0.0.1")) == 0
    assert modify(root, TOP, deleted("orv-slapdIpAddress")) == 0


def test_good_address_beside_one_that_the_host_has_lost_is_refused(instance):
    instance.config.set(TOP, "orv-slapdIpAddress", "192.0.2.7")
    root = clients.bind(instance.start("--address", "127.0.0.1"))
    assert refusal(root, TOP, added("orv-slapdIpAddress", "127.0.0.1")) == (
        19, "IP address 192.0.2.7 is not defined for this system.")
    assert modify(root, "cn=schemas," + TOP, replaced("description", "another entry")) == 0
    assert modify(root, TOP, replaced("orv-slapdIpAddress", "127.0.0.1")) == 0
    root.unbind_s()


# ---- the audit log's file

def test_file_of_the_audit_log_has_a_default(server, root, answer):
    assert changes.delete(root, "cn=audit," + LOGS) == 0
    assert answer("cn=default," + LOGS, replaced("orv-slapdLog", DEFAULT_AUDIT_LOG)) == (53, "")
    assert answer("cn=default," + LOGS, added("orv-slapdLog", DEFAULT_AUDIT_LOG.upper()))[0] == 53


def test_file_that_a_log_should_not_have_had_may_be_deleted(instance):
    log = "cn=default," + LOGS
    file = str(instance.directory / "log" / "audit.log")
    instance.config.set(log, "orv-slapdLog", file)
    root = clients.bind(instance.start())
    assert refusal(root, log, replaced("orv-slapdLog", file)) == (53, "")
    assert modify(root, log, deleted("orv-slapdLog", file)) == 0
    root.unbind_s()


# ---- safe mode

def test_every_password_encryption_passes_in_safe_mode(instance):
    root = clients.bind(instance.start("--safe-mode"))
    assert refusal(root, TOP, replaced("orv-slapdPwEncryption", "rot13")) == (0, "")
    root.unbind_s()
    instance.stop()
    root = clients.bind(instance.start("--safe-mode"))
    assert refusal(root, TOP, replaced("orv-slapdPwEncryption", "AES256")) == (0, "")
    root.unbind_s()
