"""Modifications that fail cost the server memory, so their number is bounded."""

import re

import ldap

from orv_e2e import clients, programs
from orv_e2e.changes import GROUP, PASSWORD, add, member, modify

LIMIT = 1 << 20
VALUE = "x" * 60000  # one fails for some 60 kB
MEBIBYTES = 1 << 20


def resident(pid):
    with open("/proc/%d/status" % pid, encoding="ascii") as status:
        return int(re.search(r"VmRSS:\s+(\d+) kB", status.read()).group(1)) * 1024


def fail(client, dn=clients.BASE):
    """A modify of a member that has no role for it."""
    return modify(client, dn, (ldap.MOD_REPLACE, "description", [VALUE]))


def limited(instance):
    instance.config.set(clients.BASE, "orv-slapdMaxFailedChangeSize", str(LIMIT))
    instance.start()
    assert add(clients.bind(instance), *member("carol", roles=["NoAdmin"])) == 0
    return instance


def until_refused(client):
    for number in range(1000):
        code = fail(client)
        if code == 51:
            return number
        assert code == 50
    raise AssertionError("never refused")


def test_memory_stays_flat_once_the_allowance_is_used_up(instance):
    server = limited(instance)
    admitted = 0
    for _ in range(6):
        admitted += until_refused(clients.bind(server, "cn=carol", PASSWORD))
    assert LIMIT / 2 < admitted * len(VALUE) < 2 * LIMIT
    assert server.stderr.wait_for(re.compile(
        r'modify by "CN=CAROL" refused with 51: too many modifications failed').search)
    client = clients.bind(server, "cn=carol", PASSWORD)
    for _ in range(20):
        assert fail(client) == 51
    before = resident(server.process.pid)
    for _ in range(1000):  # 60 MB, if it were kept
        assert fail(client) == 51
    # A sanitizer keeps what was freed.
    assert programs.sanitized() or resident(server.process.pid) - before < 15 * MEBIBYTES


def test_others_and_other_requests_are_served_meanwhile(instance):
    server = limited(instance)
    for _ in range(6):
        until_refused(clients.bind(server, "cn=carol", PASSWORD))
    carol = clients.bind(server, "cn=carol", PASSWORD)
    assert clients.read(carol, clients.BASE)
    own = "cn=carol," + GROUP
    assert modify(carol, own, (ldap.MOD_REPLACE, "orv-slapdAdminPW", ["Qm4&wt8?Lb6%"])) == 51
    root = clients.bind(server)
    assert modify(root, own, (ldap.MOD_REPLACE, "orv-slapdAdminPW", ["Qm4&wt8?Lb6%"])) == 0
    clients.bind(server, "cn=carol", "Qm4&wt8?Lb6%")


def test_many_members_do_not_add_up_and_keep_nobody_else_out(instance):
    instance.config.set(clients.BASE, "orv-slapdMaxFailedChangeTotalSize", str(LIMIT))
    instance.start()
    root = clients.bind(instance)
    names = ["carol", "dave", "erin"]
    for name in names:
        assert add(root, *member(name, roles=["NoAdmin"])) == 0
    first, second, third = (clients.bind(instance, "cn=" + name, PASSWORD) for name in names)
    admitted = 0
    for _ in range(1000):
        if fail(first) != 50 or fail(second) != 50:
            break
        admitted += 2
    assert LIMIT / 2 < admitted * len(VALUE) < 2 * LIMIT
    assert fail(third) == 51
    assert instance.stderr.wait_for(re.compile(
        r'modify by "CN=[A-Z]*" refused with 51: too many modifications of all').search)
    assert clients.read(third, clients.BASE)
    assert modify(root, clients.BASE, (ldap.MOD_REPLACE, "description", ["x"])) == 0
    assert modify(root, clients.BASE, (ldap.MOD_REPLACE, "orv-slapdPort", [VALUE])) not in (0, 51)


def test_limit_is_a_setting_that_is_in_force_at_once(instance):
    server = limited(instance)
    for _ in range(6):
        until_refused(clients.bind(server, "cn=carol", PASSWORD))
    root = clients.bind(server)
    assert modify(root, clients.BASE, (ldap.MOD_REPLACE, "orv-slapdMaxFailedChangeSize",
                                       [str(64 * LIMIT)])) == 0
    assert fail(clients.bind(server, "cn=carol", PASSWORD)) == 50
    assert modify(root, clients.BASE, (ldap.MOD_REPLACE, "orv-slapdMaxFailedChangeSize",
                                       ["65535"])) == 19
