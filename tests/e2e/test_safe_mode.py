"""In safe mode, and on a server of kind 1, the first look at a pass-through entry is one at all that
the file has already: what is wrong there is told, and refuses nothing."""

import pytest

from orv_e2e import changes, clients


@pytest.fixture(name="overlapping")
def overlapping_fixture(instance):
    """An instance whose file somebody has edited, so that two entries overlap."""
    for name, subtree in (("outer", "o=example"), ("inner", "ou=a,o=example")):
        dn, attributes = changes.pass_through(name, subtree)
        instance.config.add(dn, list(attributes.items()))
    return instance


def told(instance):
    return [line for line in instance.stderr.lines() if "overlap" in line]


@pytest.mark.parametrize("options", [("--safe-mode",), ("--server-type", "1")])
def test_first_add_tells_once_what_overlaps_in_the_file_and_succeeds(overlapping, options):
    overlapping.start(*options)
    root = clients.bind(overlapping)
    assert told(overlapping) == []
    for name in ("first", "second"):
        assert changes.add(root, *changes.pass_through(name, "o=" + name)) == 0
    root.unbind_s()
    overlapping.stop()
    lines = told(overlapping)
    assert len(lines) == 2
    assert "'O=EXAMPLE' and 'OU=A,O=EXAMPLE' overlap" in lines[0]
    assert "'OU=A,O=EXAMPLE' and 'O=EXAMPLE' overlap" in lines[1]


def test_other_servers_look_only_at_the_entry_that_is_added(overlapping):
    overlapping.start()
    root = clients.bind(overlapping)
    assert changes.add(root, *changes.pass_through("first", "o=first")) == 0
    root.unbind_s()
    overlapping.stop()
    assert told(overlapping) == []
