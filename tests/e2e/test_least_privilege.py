"""The daemon gives up root's rights, and keeps from starting where files are open to others."""

import os
import signal
import socket
import stat
import subprocess

import ldap
import pytest

from orv_e2e import clients, programs, users
from orv_e2e.certificates import Authority
from orv_e2e.changes import GROUP
from orv_e2e.instance import Instance

NO_RIGHTS = ["0" * 16]


@pytest.fixture(name="owned")
def owned_instance(open_folder):
    made = users.instance_of(open_folder / "instance")
    yield made
    made.stop()


def low_port():
    """A port below 1024 that nobody listens at."""
    for port in range(1023, 600, -1):
        with socket.socket() as probe:
            try:
                probe.bind(("127.0.0.1", port))
            except OSError:
                continue
            return port
    raise AssertionError("no port below 1024 is free")


# ---- the user

@users.needs_root
def test_no_thread_keeps_a_right_or_a_way_back(owned):
    port = low_port()
    owned.start(*users.options(), "--secure-port", str(port))
    assert owned.secure_port == port
    threads = users.status_of_threads(owned.process.pid)
    assert len(threads) > 4
    for thread in threads:
        assert thread["Uid"] == [str(users.USER)] * 4
        assert thread["Gid"] == [str(users.GROUP)] * 4
        assert thread["Groups"] == []
        for rights in ("CapInh", "CapPrm", "CapEff", "CapAmb"):
            assert thread[rights] == NO_RIGHTS
        assert thread["NoNewPrivs"] == ["1"]


@users.needs_root
def test_everything_works_as_that_user(owned):
    owned.start(*users.options())
    root = clients.bind(owned)
    top = "cn=configuration"
    root.modify_s(top, [(ldap.MOD_REPLACE, "orv-slapdSizeLimit", [b"500"])])
    assert root.search_s(top, ldap.SCOPE_BASE)[0][1]["orv-slapdSizeLimit"] == [b"500"]
    root.unbind_s()
    logs = owned.directory / "log"
    for log in logs.iterdir():
        log.rename(log.with_name(log.name + ".1"))
    owned.process.send_signal(signal.SIGHUP)
    owned.stderr.wait_for(lambda line: "settings taken over" in line)
    clients.bind(owned).unbind_s()
    owned.stop()
    assert {path.name for path in logs.iterdir()} >= {"access.log", "access.log.1", "audit.log"}
    for path in [owned.directory, *owned.directory.rglob("*")]:
        assert (path.stat().st_uid, path.stat().st_gid) == (users.USER, users.GROUP), path
    assert (logs / "access.log").stat().st_size > 0


@users.needs_root
def test_user_of_the_host_gets_its_groups(open_folder):
    made = users.instance_of(open_folder / "instance", "nobody", "nogroup")
    made.start("--user", "nobody")
    found = users.status_of_threads(made.process.pid)[0]
    made.stop()
    assert found["Groups"] == subprocess.run(["id", "-G", "nobody"], check=True, text=True,
                                             stdout=subprocess.PIPE).stdout.split()


@users.needs_root
@pytest.mark.parametrize("given, text", [
    (["--user", "orv-nobody-has-this"], "there is no user orv-nobody-has-this on this host"),
    (["--user", "nobody", "--group", "orv-none"], "there is no group orv-none on this host"),
    (["--user", str(users.USER)], "name one as well (--group)"),
    (["--user", "root"], "is root, or in root's group"),
    (["--user", "nobody", "--group", "0"], "is root, or in root's group"),
])
def test_user_that_cannot_be_is_named(instance, given, text):
    code, told = instance.start_refused(*given)
    assert code == 1 and text in told


def as_user(user=users.USER, group=users.GROUP):
    return ["setpriv", "--reuid", str(user), "--regid", str(group), "--clear-groups"]


@users.needs_root
def test_only_root_becomes_somebody_else(owned):
    code, told = owned.start_refused("--user", "nobody", wrapper=as_user())
    assert code == 1 and "only root can become another user (--user nobody)" in told
    owned.start(*users.options(), wrapper=as_user())  # who is that user already


def low_ports_are_anybodys():
    """As in many containers."""
    with open("/proc/sys/net/ipv4/ip_unprivileged_port_start", encoding="ascii") as start:
        return int(start.read()) < 1024


@users.needs_root
@pytest.mark.skipif(low_ports_are_anybodys(), reason="here no right is needed for low ports")
def test_low_port_without_the_right_to_it_is_told_of(owned):
    code, told = owned.start_refused("--secure-port", str(low_port()), wrapper=[
        *as_user(), "--bounding-set=-all", "--inh-caps=-all"])
    assert code == 1 and "Permission denied; ports below 1024 need a start as root" in told


@users.needs_root
def test_right_to_low_ports_that_was_given_is_given_up(owned):
    port = low_port()
    owned.start("--secure-port", str(port), wrapper=[
        *as_user(), "--inh-caps", "+net_bind_service", "--ambient-caps", "+net_bind_service"])
    assert owned.secure_port == port
    threads = users.status_of_threads(owned.process.pid)
    if programs.sanitized():  # has a thread of its own from before the program begins
        threads = [thread for thread in threads if thread["Pid"] == [str(owned.process.pid)]]
    for thread in threads:
        assert thread["CapPrm"] == thread["CapEff"] == thread["CapAmb"] == NO_RIGHTS


@users.needs_root
@pytest.mark.parametrize("name, purpose", [
    ("", "changes of the configuration"), ("config.ldif.lock", "changes of the configuration"),
    ("log", "the access log"), ("log/audit.log", "the audit log"), ("elsewhere", "the local socket"),
])
def test_what_the_user_cannot_write_is_named(owned, name, purpose):
    path = owned.directory / name
    if name == "elsewhere":
        path.mkdir(mode=0o755)
        owned.config.set("cn=configuration", "orv-slapdLocalSocket", str(path / "ldapi"))
        users.give(owned.config.path)
    else:
        if not path.is_dir():
            path.write_bytes(b"")
            path.chmod(0o600)
        users.give(path, 0, 0)
        if path.is_dir():
            path.chmod(0o755)
    code, told = owned.start_refused(*users.options())
    assert code == 1
    assert any(str(path) in line and purpose in line and "chown %d" % users.USER in line
               for line in told.splitlines()), told


def file_of_setting(owned, name):
    """A file of the server's user, in the place of what the setting names."""
    path = owned.directory / name
    path.touch(mode=0o600)
    users.give(path)
    owned.config.set(GROUP, name, str(path))
    owned.config.set(GROUP, "orv-slapdTlsClientCertificate", "optional")
    users.give(owned.config.path)
    return path


READ = ["orv-slapdTlsCertificateFile", "orv-slapdTlsKeyFile", "orv-slapdTlsCaFile",
        "orv-slapdTlsCrlFile", "orv-slapdKrbKeytab"]


@users.needs_root
@pytest.mark.parametrize("name", ["key.stash", *READ])
@pytest.mark.parametrize("checked", [False, True])
def test_files_that_the_user_cannot_read_are_named(owned, name, checked):
    path = owned.key_stash if name == "key.stash" else file_of_setting(owned, name)
    users.give(path, 0, 0)
    code, told = owned.start_refused(*users.options(), *(["--check"] if checked else []))
    assert code == 1
    assert ("orvd: %s: the server runs as %d, which may not read it (Permission denied); give it to "
            "that user (chown %d %s)" % (path, users.USER, users.USER, path)) in told


@users.needs_root
@pytest.mark.parametrize("name, without", [
    ("orv-slapdTlsCaFile", ("orv-slapdTlsClientCertificate", "none")),
    ("orv-slapdTlsCrlFile", ("orv-slapdTlsClientCertificate", "none")),
    ("orv-slapdKrbKeytab", ("orv-slapdSaslMechanisms", "EXTERNAL")),
    ("orv-slapdTlsKeyFile", ("orv-slapdTlsCertificateFile",)),
])
def test_files_of_settings_that_do_not_count_are_not_read(owned, name, without):
    path = file_of_setting(owned, name)
    owned.config.set(GROUP, "orv-slapdTlsClientCertificate", "none")
    owned.config.set(GROUP, *without)
    users.give(owned.config.path)
    users.give(path, 0, 0)
    owned.start(*users.options())


@users.needs_root
@pytest.mark.parametrize("name", READ)
def test_files_that_the_user_may_not_read_any_more_are_named(owned, name):
    owned.start(*users.options())
    path = file_of_setting(owned, name)
    users.give(path, 0, 0)
    owned.process.send_signal(signal.SIGHUP)
    owned.stderr.wait_for(lambda line: "%s: the server runs as %d, which may not read it" %
                          (path, users.USER) in line)
    clients.bind(owned).unbind_s()


@users.needs_root
def test_root_does_not_serve_files_of_another_user(owned):
    code, told = owned.start_refused()
    assert code == 1 and "belongs to %d" % users.USER in told
    assert "it must be root's (chown)" in told
    assert "or start with --user %d" % users.USER in told
    subprocess.run([*owned.command(), "--check"], check=True, stdout=subprocess.PIPE,
                   timeout=programs.DEADLINE)  # it may look at them


@users.needs_root
def test_instance_that_the_server_would_refuse_is_told_of_when_it_is_made(open_folder):
    folder = open_folder / "instance"
    folder.mkdir(mode=0o700)
    users.give(folder)
    made = subprocess.run([programs.orvcfg(), "init", "--dir", folder], check=True, text=True,
                          stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=programs.DEADLINE)
    assert "warning: the server will refuse this: %s: this folder belongs to" % folder in made.stderr
    other = open_folder / "other"
    users.give(open_folder, 0, 0)
    made = subprocess.run([programs.orvcfg(), "init", "--dir", other], check=True, text=True,
                          stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=programs.DEADLINE)
    assert made.stderr == ""


def test_server_that_stays_root_says_so(server):
    if os.geteuid() == 0:
        server.stderr.wait_for(lambda line: "warning the server runs as root" in line)


# ---- files that are open to others

def refused(instance):
    code, told = instance.start_refused()
    assert code == 1
    checked = subprocess.run([programs.orvcfg(), "check", instance.config.path, "--key-stash",
                              instance.key_stash], text=True, stdout=subprocess.PIPE, check=False,
                             timeout=programs.DEADLINE)
    assert checked.returncode == 1
    line = told.removeprefix("orvd: ").splitlines()[0]
    assert line in checked.stdout.splitlines()  # the tool says the same
    return line


@pytest.mark.parametrize("mode", [0o604, 0o602, 0o620, 0o601])
def test_configuration_that_is_open_to_others_is_refused(instance, mode):
    path = instance.config.path
    path.chmod(mode)
    line = refused(instance)
    assert line.startswith("%s: the configuration file can be read or changed by others" % path)
    subprocess.run(line.partition("; ")[2], shell=True, check=True)  # what it says helps
    instance.start()


def test_configuration_may_be_read_by_its_group(instance):
    instance.config.path.chmod(0o640)
    instance.start()


@pytest.mark.parametrize("mode", [0o604, 0o640, 0o620])
def test_key_stash_that_is_open_to_others_is_refused(instance, mode):
    instance.key_stash.chmod(mode)
    line = refused(instance)
    assert line.startswith("%s: the key stash is open to others" % instance.key_stash)
    subprocess.run(line.partition("; ")[2], shell=True, check=True)
    instance.start()


@pytest.mark.parametrize("mode", [0o770, 0o707, 0o733])
def test_folder_in_which_others_can_write_is_refused(instance, mode):
    instance.directory.chmod(mode)
    line = refused(instance)
    assert line.startswith("%s: this folder can be written by others" % instance.directory)
    subprocess.run(line.partition("; ")[2], shell=True, check=True)
    instance.start()


def test_folder_in_which_others_cannot_replace_files_is_good(instance):
    instance.directory.chmod(0o1777)
    instance.start()


def test_link_in_a_folder_of_others_is_refused(instance, tmp_path):
    open_to_all = tmp_path / "open"
    open_to_all.mkdir()
    link = open_to_all / "config.ldif"
    link.symlink_to(instance.config.path)
    open_to_all.chmod(0o777)
    instance.config.path = link
    assert refused(instance).startswith("%s: this folder can be written by others" % open_to_all)
    open_to_all.chmod(0o755)
    instance.start()


@users.needs_root
def test_files_of_others_are_refused(instance, tmp_path):
    stash = instance.key_stash
    users.give(stash)
    code, told = instance.start_refused()
    assert code == 1 and "%s: the key stash belongs to %d" % (stash, users.USER) in told
    users.give(stash, 0, 0)
    link = tmp_path / "link"
    link.symlink_to(stash)
    os.chown(link, users.USER, users.GROUP, follow_symlinks=False)
    instance.key_stash = link
    code, told = instance.start_refused()
    assert code == 1 and "%s: this link belongs to %d" % (link, users.USER) in told
    instance.key_stash = stash
    users.give(instance.directory)
    code, told = instance.start_refused()
    assert code == 1 and "%s: this folder belongs to" % instance.directory in told


def test_file_that_is_opened_to_others_meanwhile_is_told_of(server):
    server.config.path.chmod(0o644)
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "can be read or changed by others" in line)


# ---- files that say whom the server believes

@pytest.fixture(name="believing")
def believing_instance(open_folder):
    """An instance that takes certificates of clients, and the files that say which, by setting."""
    made = Instance.create(open_folder / "instance")
    authority = Authority(open_folder / "ca")
    files = {"orv-slapdTlsCaFile": authority.certificate,
             "orv-slapdTlsCrlFile": authority.revocations()}
    for name, path in files.items():
        path.chmod(0o644)
        made.config.set(GROUP, name, str(path))
    made.config.set(GROUP, "orv-slapdTlsClientCertificate", "optional")
    yield made, files
    made.stop()


AUTHORITIES = ["orv-slapdTlsCaFile", "orv-slapdTlsCrlFile"]


@pytest.mark.parametrize("mode", [0o666, 0o664])
@pytest.mark.parametrize("name", AUTHORITIES)
def test_authorities_that_others_could_change_are_refused(believing, name, mode):
    instance, files = believing
    files[name].chmod(mode)
    line = refused(instance)
    assert line == ("%s: what says whom the server believes can be changed by others; chmod go-w %s"
                    % (files[name], files[name]))
    checked = subprocess.run(instance.command("--check"), stdout=subprocess.PIPE, text=True,
                             stderr=subprocess.PIPE, timeout=programs.DEADLINE, check=False)
    assert checked.returncode == 1 and line in checked.stderr
    subprocess.run(line.partition("; ")[2], shell=True, check=True)  # what it says helps
    instance.start()


@pytest.mark.parametrize("name", AUTHORITIES)
def test_authorities_in_a_folder_of_others_are_refused(believing, name):
    instance, files = believing
    folder = files[name].parent
    folder.chmod(0o777)
    assert refused(instance).startswith("%s: this folder can be written by others" % folder)
    folder.chmod(0o755)
    instance.start()


def test_authorities_that_are_opened_to_others_meanwhile_are_not_taken_over(believing):
    instance, files = believing
    instance.start()
    path = files["orv-slapdTlsCaFile"]
    path.chmod(0o666)
    instance.process.send_signal(signal.SIGHUP)
    instance.stderr.wait_for(lambda line: "TLS stays as it was: %s: what says whom" % path in line)
    root = clients.bind(instance)
    with pytest.raises(ldap.UNWILLING_TO_PERFORM) as refusal:
        root.modify_s(GROUP, [(ldap.MOD_REPLACE, "orv-slapdTlsClientCertificate", [b"required"])])
    assert str(path) in refusal.value.args[0]["info"]


@users.needs_root
def test_authorities_may_be_the_servers_own_and_nobody_elses(believing):
    instance, files = believing
    path = files["orv-slapdTlsCaFile"]
    users.give(path)
    code, told = instance.start_refused()
    assert code == 1
    assert "%s: what says whom the server believes belongs to %d" % (path, users.USER) in told
    for own in [instance.directory, *instance.directory.rglob("*"), path.parent]:
        users.give(own)
    subprocess.run(instance.command("--check"), check=True, stdout=subprocess.PIPE,
                   timeout=programs.DEADLINE)  # root may look at what belongs to another server
    instance.start(*users.options())


# ---- orvcfg init

@users.needs_root
def test_init_makes_an_instance_for_a_user(open_folder):
    made = users.instance_of(open_folder / "instance")
    for path in [made.directory, *made.directory.rglob("*")]:
        status = path.stat()
        assert (status.st_uid, status.st_gid) == (users.USER, users.GROUP)
        assert stat.S_IMODE(status.st_mode) == (0o700 if path.is_dir() else 0o600)


def init_refused(folder, *options, wrapper=()):
    result = subprocess.run([*wrapper, programs.orvcfg(), "init", "--dir", folder, *options],
                            text=True, stdout=subprocess.PIPE, stderr=subprocess.PIPE, check=False,
                            timeout=programs.DEADLINE)
    assert result.returncode == 1
    return result.stderr


@users.needs_root
def test_init_takes_no_folder_of_somebody_else(open_folder):
    folder = open_folder / "instance"
    folder.mkdir(mode=0o755)
    assert "belongs to root; give it to" in init_refused(folder, *users.options())
    assert folder.stat().st_uid == 0 and not list(folder.iterdir())


@users.needs_root
def test_init_leaves_nothing_behind_when_the_user_cannot_get_there(open_folder):
    closed = open_folder / "closed"
    closed.mkdir(mode=0o700)
    assert "Permission denied" in init_refused(closed / "instance", *users.options())
    assert not list(closed.iterdir())


@users.needs_root
def test_init_for_another_user_needs_root(open_folder):
    place = open_folder / "place"
    place.mkdir()
    users.give(place)
    text = init_refused(place / "instance", "--user", "nobody", wrapper=as_user())
    assert "only root can make an instance for another user" in text
    assert not list(place.iterdir())
