"""Administrators are locked out by failed binds, as the password policy says."""

import ldap
import pytest

from orv_e2e import clients
from orv_e2e.changes import GROUP, PASSWORD, add, member

POLICY = "cn=pwdpolicy admin,cn=configuration"
FAILURES = 3


def bind_code(instance, password, who="cn=carol"):
    return clients.bind_code(instance, who, password)


def replace(client, dn, name, value):
    client.modify_s(dn, [(ldap.MOD_REPLACE, name, [value.encode()])])


@pytest.fixture(name="locked")
def locked_fixture(server, root):
    """A server that locks out after three failures, and has locked out the member carol."""
    assert add(root, *member("carol")) == 0
    replace(root, POLICY, "pwdMaxFailure", str(FAILURES))
    for _ in range(FAILURES):
        assert bind_code(server, "wrong") == 49
    return server


def test_right_password_is_refused_after_too_many_wrong_ones(locked):
    assert bind_code(locked, PASSWORD) == 49


def test_others_are_not_locked_out(locked, root):
    assert add(root, *member("dave")) == 0
    assert bind_code(locked, PASSWORD, "cn=dave") == 0
    assert bind_code(locked, locked.password, "cn=root") == 0


def test_success_in_time_forgets_the_failures(server, root):
    assert add(root, *member("carol")) == 0
    replace(root, POLICY, "pwdMaxFailure", str(FAILURES))
    for _ in range(3):
        for _ in range(FAILURES - 1):
            assert bind_code(server, "wrong") == 49
        assert bind_code(server, PASSWORD) == 0


def test_new_password_ends_the_lockout(locked, root):
    replace(root, "cn=carol," + GROUP, "orv-slapdAdminPW", "Qm4&wt8?Lb6%")
    assert bind_code(locked, "Qm4&wt8?Lb6%") == 0


def test_lockout_ends_when_the_policy_has_none(locked, root):
    replace(root, POLICY, "pwdLockout", "FALSE")
    assert bind_code(locked, PASSWORD) == 0


def test_member_added_by_hand_is_locked_out_as_others_are(server, root):
    replace(root, POLICY, "pwdMaxFailure", str(FAILURES))
    server.config.add_member("erin", "in the open")
    for _ in range(FAILURES):
        assert bind_code(server, "wrong", "cn=erin") == 49
    assert bind_code(server, "in the open", "cn=erin") == 49


def test_password_changed_by_hand_ends_the_lockout_with_the_next_bind(locked):
    locked.config.set("cn=carol," + GROUP, "orv-slapdAdminPW", "in the open")
    assert bind_code(locked, "in the open") == 0
