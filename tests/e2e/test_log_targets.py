"""Logs that are set over LDAP or by SIGHUP never go where they would harm; the old log goes on."""

import os
import signal

import pytest

from orv_e2e import clients
from orv_e2e.changes import LOGS, add, delete

ACCESS_LOG = "cn=access," + LOGS


def log_entry(path):
    return {"objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdLogSettings"],
            "cn": ["access"], "orv-slapdLog": [str(path)], "orv-slapdLogLevel": ["info"]}


def settled(instance, start, text="settings taken over"):
    instance.stderr.wait_for(lambda line: text in line, start=start)


def refused_line(instance, start, path):
    return instance.stderr.wait_for(lambda line: "cannot log to " + str(path) in line, start=start)


@pytest.mark.parametrize("name", ["config.ldif", "config.ldif.save", "config.ldif.lock", "key.stash",
                                  "admin.pw", "log/audit.log"])
@pytest.mark.parametrize("linked", [False, True])
def test_log_added_over_ldap_does_not_go_into(server, root, name, linked):
    target = server.directory / name
    assert delete(root, ACCESS_LOG) == 0
    settled(server, 0)
    if linked:
        alias = server.directory / "log" / "alias"
        # A link to the version in place is a link to the save file after the next change.
        os.link(target, alias)
        target = alias
    start = len(server.stderr.lines())
    assert add(root, ACCESS_LOG, log_entry(target)) == 0
    if linked and name == "config.ldif":
        line = refused_line(server, start, target)
        assert "config.ldif.save" in line
    elif linked and name == "config.ldif.save":
        pass  # a version that is no file of the instance any more
    else:
        assert "the same file as" in refused_line(server, start, target)
    settled(server, start)
    before = (server.directory / name).read_bytes()
    clients.read(root, clients.BASE)
    assert (server.directory / name).read_bytes() == before
    assert b" conn=" not in before
    clients.parse_ldif(server.config.read())


def test_log_added_over_ldap_is_written_at_once(server, root):
    path = server.directory / "log" / "second.log"
    assert delete(root, ACCESS_LOG) == 0
    settled(server, 0)
    start = len(server.stderr.lines())
    assert add(root, ACCESS_LOG, log_entry(path)) == 0
    settled(server, start)
    clients.read(root, clients.BASE)
    server.stop()
    assert "SEARCH" in path.read_text()


@pytest.mark.parametrize("path", ["relative.log", "log/access.log", "./x", "../x", " /x", ""])
def test_relative_path_is_refused(server, root, path):
    assert delete(root, ACCESS_LOG) == 0
    assert add(root, ACCESS_LOG, log_entry(path)) == 21


@pytest.mark.parametrize("kind", ["directory", "pipe", "device", "no folder"])
def test_what_is_no_regular_file_is_refused_and_the_old_log_goes_on(server, root, kind):
    target = server.directory / "target"
    if kind == "directory":
        target.mkdir()
    elif kind == "pipe":
        os.mkfifo(target)
    elif kind == "device":
        target = "/dev/null"
    else:
        target = server.directory / "nowhere" / "access.log"
    server.config.set(ACCESS_LOG, "orv-slapdLog", str(target))
    server.process.send_signal(signal.SIGHUP)
    refused_line(server, 0, target)
    settled(server, 0)
    clients.names(root, "(cn=after the reload)")
    server.stop()
    assert "after the reload" in server.access_log.read_text()


def test_relative_path_in_the_file_keeps_all_settings(server, root):
    server.config.set(ACCESS_LOG, "orv-slapdLog", "access.log")
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "settings not taken over" in line
                           and "not an absolute path" in line)
    clients.names(root, "(cn=after the reload)")
    server.stop()
    assert "after the reload" in server.access_log.read_text()
