"""Signals: stop in order, read the settings again, open the logs again."""

import signal
import time

import ldap
import pytest
from ldap.extop import ExtendedRequest

from orv_e2e import clients, wire
from orv_e2e.config_file import record
from orv_e2e.programs import DEADLINE


def eventually(condition, what):
    """Asks until the condition holds; fails at the deadline."""
    limit = time.monotonic() + DEADLINE
    while not condition():
        assert time.monotonic() < limit, what
    return True


def size_limited(client):
    try:
        clients.search(client, attributes=["1.1"])
        return False
    except ldap.SIZELIMIT_EXCEEDED:
        return True


@pytest.mark.parametrize("number", [signal.SIGTERM, signal.SIGINT])
def test_idle_server_ends_with_0_after(server, number):
    server.stop(number)


def test_stop_closes_connections_of_idle_clients(server):
    with wire.bound(server) as idle:
        server.stop()
        assert all(answer.is_notice for answer in idle.answers_until_closed())


def test_server_that_stops_accepts_nobody_any_more(server):
    server.stop()
    with pytest.raises(OSError):
        wire.Wire(server)


def test_stop_with_operations_in_flight_ends_with_0(instance):
    entries = [record("cn=e%d,cn=schemas,cn=configuration" % i,
                      [("objectClass", ["top", "container"]), ("cn", "e%d" % i),
                       ("description", "x" * 200)]) for i in range(5000)]
    instance.config.append(b"\n".join(entries))
    instance.start()
    busy = [wire.bound(instance) for _ in range(16)]
    for connection in busy:
        connection.send(b"".join(wire.search_request(number, scope=2, attributes=())
                                 for number in range(2, 12)))
    # The first answer shows that the server is in the middle of it.
    assert busy[0].answer().tag == wire.SEARCH_ENTRY
    instance.stop()
    for connection in busy:
        connection.close()


def test_stop_while_a_client_does_not_read_ends_with_0(instance):
    entries = [record("cn=e%d,cn=schemas,cn=configuration" % i,
                      [("objectClass", ["top", "container"]), ("cn", "e%d" % i),
                       ("description", "x" * 100000)]) for i in range(200)]
    instance.config.append(b"\n".join(entries))
    instance.start()
    with wire.Wire(instance, receive_buffer=4096) as stuck:
        assert stuck.bind("cn=root", instance.password) == 0
        stuck.send(wire.search_request(2, scope=2, attributes=()))
        assert stuck.answer().tag == wire.SEARCH_ENTRY
        instance.stop()


def test_further_signals_during_the_stop_do_no_harm(server):
    deadline = time.monotonic() + DEADLINE
    while server.process.poll() is None and time.monotonic() < deadline:
        server.process.send_signal(signal.SIGTERM)
    server.assert_ended_in_order()


def test_hangup_takes_over_changed_limits(server):
    client = clients.bind(server)
    assert not size_limited(client)
    server.config.set(clients.BASE, "orv-slapdSizeLimit", "2")
    assert not size_limited(client), "settings changed without being told to"
    server.process.send_signal(signal.SIGHUP)
    eventually(lambda: size_limited(client), "the size limit did not change")


def test_hangup_with_a_damaged_file_keeps_the_settings(server):
    client = clients.bind(server)
    whole = server.config.read()
    seen = len(server.stderr.lines())
    server.config.replace(b"dn: cn=confi")
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: str(server.config.path) in line, start=seen)
    server.config.replace(whole)
    assert not size_limited(client)
    server.config.set(clients.BASE, "orv-slapdSizeLimit", "2")
    server.process.send_signal(signal.SIGHUP)
    eventually(lambda: size_limited(client), "the next reload was not taken")


def test_hangup_with_an_unusable_setting_keeps_the_settings_and_says_so(server):
    client = clients.bind(server)
    seen = len(server.stderr.lines())
    server.config.set(clients.BASE, "orv-slapdSizeLimit", "many")
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "orv-slapdSizeLimit" in line, start=seen)
    assert not size_limited(client)


def test_hangup_opens_renamed_logs_again(server):
    old = server.access_log.with_suffix(".1")
    clients.bind(server).unbind_s()
    eventually(lambda: server.access_log.exists() and server.access_log.stat().st_size > 0,
               "nothing was logged")
    server.access_log.rename(old)
    server.process.send_signal(signal.SIGHUP)
    eventually(server.access_log.exists, "the log was not opened again")
    length = old.stat().st_size
    clients.bind(server).unbind_s()
    eventually(lambda: server.access_log.stat().st_size > 0, "nothing more was logged")
    server.stop()
    assert b"root" in server.access_log.read_bytes()
    assert old.stat().st_size >= length


def test_many_hangups_between_searches_do_no_harm(server):
    client = clients.bind(server)
    for _ in range(50):
        server.process.send_signal(signal.SIGHUP)
        assert len(clients.search(client, scope=ldap.SCOPE_BASE)) == 1


def test_access_log_names_operations_but_no_password(server):
    client = clients.bind(server)
    clients.search(client, filter_text="(cn=audit)")
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        clients.bind(server, password="a very wrong password")
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        client.compare_s(clients.BASE, "orv-slapdAdminPW", b"a guessed password")
    with pytest.raises(ldap.PROTOCOL_ERROR):
        client.extop_s(ExtendedRequest("1.2.3.4", b"an extended password"))
    clients.search(client, filter_text="(orv-slapdAdminPW=a filtered password)")
    named = "orv-slapdAdminPW=a named password,cn=configuration"
    with pytest.raises(ldap.LDAPError):
        clients.search(client, base=named)
    with pytest.raises(ldap.LDAPError):
        client.delete_s(named)
    with pytest.raises(ldap.LDAPError):
        client.add_s(named, [("objectClass", [b"top"])])
    with pytest.raises(ldap.LDAPError):
        clients.bind(server, who=named, password="x")
    password = server.password.encode()
    server.stop()
    logged = server.access_log.read_bytes() + server.stderr.text().encode()
    assert b"audit" in logged.lower()
    for secret in (password, b"a very wrong", b"a guessed", b"a filtered", b"an extended",
                   b"a named"):
        assert secret not in logged


def test_log_file_is_for_the_owner_alone(server):
    clients.bind(server)
    server.stop()
    assert server.access_log.stat().st_mode & 0o077 == 0
