"""What the error log tells about a file that became unusable while the server runs."""

import ldap

from orv_e2e import clients
from orv_e2e.config_file import record


def search_code(client):
    return clients.code_of(clients.search, client, scope=ldap.SCOPE_BASE)


def causes(server):
    return [line for line in server.stderr.lines() if " error " in line and "config.ldif" in line
            and "operations fail" in line]


def wait_for_cause(server, start, text="operations fail"):
    return server.stderr.wait_for(lambda line: text in line and " error " in line, start=start)


def test_cause_of_failing_searches_is_logged_once_for_each_state_of_the_file(server, root):
    whole = server.config.read()
    start = len(server.stderr.lines())
    server.config.replace(whole + b"\nno colon here\n")
    bad_line = len(server.config.read().splitlines())
    for _ in range(20):
        assert search_code(root) == 1
    line = wait_for_cause(server, start)
    assert "%s: line %d, column 1: " % (server.config.path, bad_line) in line
    for _ in range(20):
        assert search_code(root) == 1
    start = len(server.stderr.lines())
    server.config.replace(b"\n" + whole + b"\nno colon here\n")
    assert search_code(root) == 1
    line = wait_for_cause(server, start)
    assert "%s: line %d, column 1: " % (server.config.path, bad_line + 1) in line
    server.config.replace(whole)
    assert search_code(root) == 0
    server.stop()
    assert len(causes(server)) == 2


def test_file_that_goes_away_is_named_with_the_reason(server, root):
    start = len(server.stderr.lines())
    server.config.path.unlink()
    assert search_code(root) == 1
    assert "No such file" in wait_for_cause(server, start)


def test_damage_found_at_a_bind_is_logged_as_an_error(server):
    start = len(server.stderr.lines())
    server.config.replace(server.config.read() + b"\nno colon here\n")
    for _ in range(3):
        clients.bind(server)  # by the identities of the last good file
    line = server.stderr.wait_for(lambda line: "identities" in line and " error " in line,
                                  start=start)
    assert str(server.config.path) in line
    server.stop()
    found = [line for line in server.stderr.lines() if "identities" in line and " error " in line]
    assert len(found) == 1


def test_name_that_two_entries_claim_is_logged_as_a_warning_at_the_next_bind(server):
    start = len(server.stderr.lines())
    text = server.config.read()
    for name in ("a", "b"):
        text += b"\n" + record("cn=%s,cn=admingroup,cn=configuration" % name, [
            ("objectClass", ["top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"]),
            ("cn", name), ("orv-slapdAdminDN", "cn=twin"), ("orv-slapdAdminPW", "twinpassword"),
            ("orv-slapdAdminRole", "AuditAdmin")])
    server.config.replace(text)
    for _ in range(3):
        clients.bind(server)
    line = server.stderr.wait_for(lambda line: "same bind DN" in line, start=start)
    assert " warning " in line
    server.stop()
    assert len([line for line in server.stderr.lines() if "same bind DN" in line]) == 1
