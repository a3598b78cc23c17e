"""How deep a filter may be nested: the setting's largest value is what the library reads."""

import ldap
import pytest

from orv_e2e import clients

DEEPEST = 64


def nested(levels):
    return "(!" * (levels - 1) + "(objectClass=*)" + ")" * (levels - 1)


def code_of_search(client, levels):
    return clients.code_of(client.search_s, clients.BASE, ldap.SCOPE_BASE, nested(levels), ["1.1"])


def test_largest_depth_is_served_and_one_more_is_answered_11(instance):
    instance.config.set(clients.BASE, "orv-slapdMaxFilterDepth", str(DEEPEST))
    client = clients.bind(instance.start())
    assert code_of_search(client, DEEPEST) == 0
    assert code_of_search(client, DEEPEST + 1) == 11
    assert code_of_search(client, 1) == 0


@pytest.mark.parametrize("depth", ["0", str(DEEPEST + 1), "1024"])
def test_depth_out_of_range_is_refused_at_start(instance, depth):
    instance.config.set(clients.BASE, "orv-slapdMaxFilterDepth", depth)
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert "orv-slapdMaxFilterDepth must be an integer from 1 to 64" in stderr
