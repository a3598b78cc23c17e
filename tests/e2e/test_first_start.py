"""What the first start makes, and that the second start leaves it alone."""

import contextlib
import fcntl
import os
import re
import shutil
import signal
import socket
import stat
import subprocess

import pytest

from orv_e2e import clients, programs
from orv_e2e.instance import READY, Instance
from orv_e2e.output import LineCollector

MADE = ["config.ldif", "key.stash", "admin.pw", "tls.crt", "tls.key"]


def mode(path):
    return stat.S_IMODE(path.stat().st_mode)


def contents(directory):
    return {name: (directory / name).read_bytes() for name in MADE}


@pytest.mark.parametrize("name", MADE)
def test_files_of_a_new_instance_are_for_the_owner_alone(instance, name):
    assert mode(instance.directory / name) == 0o600


def test_folders_of_a_new_instance_are_for_the_owner_alone(instance):
    assert mode(instance.directory) == 0o700
    assert mode(instance.directory / "log") == 0o700


def test_modes_do_not_depend_on_the_umask(tmp_path):
    directory = tmp_path / "loose"
    subprocess.run([programs.orvcfg(), "init", "--dir", directory], check=True, umask=0,
                   stdout=subprocess.DEVNULL, timeout=programs.DEADLINE)
    assert [mode(directory / name) for name in MADE] == [0o600] * len(MADE)
    assert mode(directory) == 0o700


def test_first_password_is_one_line_without_its_newline(instance):
    password = (instance.directory / "admin.pw").read_bytes()
    assert re.fullmatch(rb"[!-~]{16,}", password)


def test_two_instances_share_neither_password_nor_key(instance, tmp_path):
    other = Instance.create(tmp_path / "other")
    assert instance.password != other.password
    assert instance.key_stash.read_bytes() != other.key_stash.read_bytes()


def test_first_password_stands_nowhere_in_the_configuration_file(instance):
    assert instance.password.encode() not in instance.config.read()


def test_init_refuses_a_folder_that_holds_an_instance(instance):
    before = contents(instance.directory)
    again = subprocess.run([programs.orvcfg(), "init", "--dir", instance.directory],
                           stderr=subprocess.PIPE, stdout=subprocess.DEVNULL, check=False,
                           timeout=programs.DEADLINE)
    assert again.returncode != 0
    assert b"config.ldif" in again.stderr
    assert contents(instance.directory) == before


def test_serving_changes_no_file(instance):
    before = contents(instance.directory)
    instance.start()
    clients.search(clients.bind(instance))
    instance.stop()
    instance.start()
    clients.search(clients.bind(instance))
    instance.stop()
    assert contents(instance.directory) == before


def test_ready_is_the_only_line_on_standard_output(server):
    clients.search(clients.bind(server))
    lines = server.stdout
    port = server.port
    server.stop()
    assert lines.lines() == ["orvd ready ldap://127.0.0.1:%d" % port]


def test_check_accepts_a_new_instance_without_listening(instance):
    checked = subprocess.run(instance.command("--check"), stdout=subprocess.PIPE,
                             stderr=subprocess.PIPE, timeout=programs.DEADLINE, check=False)
    assert checked.returncode == 0, checked.stderr
    assert b"orvd ready" not in checked.stdout


def test_name_in_the_place_of_an_address_is_refused_with_what_is_wanted(instance):
    exit_code, stderr = instance.start_refused("--address", "localhost")
    assert exit_code == 1
    assert "'localhost': not an IP address" in stderr


def test_port_and_address_of_the_file_hold_without_options(instance):
    with clients_port() as port:
        instance.config.set(clients.BASE, "orv-slapdPort", str(port))
    instance.config.set(clients.BASE, "orv-slapdSecurePort", "0")
    command = [str(programs.orvd()), "--config", str(instance.config.path), "--key-stash",
               str(instance.key_stash)]
    instance._spawn(command, None)  # pylint: disable=protected-access
    instance._wait_until_ready()  # pylint: disable=protected-access
    assert instance.url == "ldap://127.0.0.1:%d" % port


@pytest.mark.skipif(not socket.has_ipv6 or not os.path.exists("/proc/net/if_inet6"),
                    reason="this host has no IPv6")
def test_port_that_another_program_has_at_the_ipv6_addresses_is_refused(instance):
    instance.config.set(clients.BASE, "orv-slapdIpAddress")
    for _ in range(10):  # by chance somebody has the port at the IPv4 addresses, too
        with socket.create_server(("::", 0), family=socket.AF_INET6) as other:
            port = str(other.getsockname()[1])
            refused = subprocess.run(
                [programs.orvd(), "--config", instance.config.path, "--key-stash",
                 instance.key_stash, "--port", port], stdout=subprocess.PIPE,
                stderr=subprocess.PIPE, text=True, check=False, timeout=programs.DEADLINE)
        assert (refused.returncode, refused.stdout) == (1, "")
        if "0.0.0.0" not in refused.stderr:
            break
    assert "orvd: cannot listen on :: port %s: Address already in use" % port in refused.stderr


class clients_port:  # pylint: disable=invalid-name
    """A port that was free a moment ago."""

    def __enter__(self):
        self.socket = socket.socket()
        self.socket.bind(("127.0.0.1", 0))
        return self.socket.getsockname()[1]

    def __exit__(self, *_):
        self.socket.close()


def serve_script(tmp_path):
    """./serve for the programs under test. Those of another build tree than its own it gets to see in
    a copy of the repository's scripts, as a tree in which there is nothing left to build."""
    if programs.bin_dir() == programs.SOURCE_DIR / "build/dev/bin":
        return programs.SOURCE_DIR / "serve"
    return copied_scripts(tmp_path / "copy") / "serve"


def copied_scripts(root):
    (root / ".ci").mkdir(parents=True)
    for name in ["serve", "packages.txt", "CMakePresets.json", ".ci/build.sh"]:
        shutil.copy2(programs.SOURCE_DIR / name, root / name)
    tree = root / "build/dev"
    tree.mkdir(parents=True)
    (tree / "bin").symlink_to(programs.bin_dir())
    (tree / "CMakeCache.txt").write_text("CMAKE_HOME_DIRECTORY:INTERNAL=%s\n" % root)
    # Targets of the names that ./serve asks for, of which none needs anything done.
    (tree / "build.ninja").write_text("build orvd orvcfg back-config orv_catalogue: phony\n")
    return root


@contextlib.contextmanager
def serve(script, directory):
    """./serve, which starts the daemon in its place, for the length of the block; ends in order."""
    process = subprocess.Popen(
        [script, "--dir", directory, "--port", "0"], stdin=subprocess.DEVNULL,
        stdout=subprocess.PIPE, stderr=subprocess.PIPE, cwd=directory.parent, start_new_session=True)
    try:
        yield LineCollector(process.stdout), LineCollector(process.stderr)
    except BaseException:
        os.killpg(process.pid, signal.SIGKILL)
        process.wait()
        raise
    process.terminate()
    assert process.wait(programs.DEADLINE) == 0


def test_serve_makes_an_instance_once_and_serves_it(tmp_path):
    directory = tmp_path / "var"
    script = serve_script(tmp_path)
    with serve(script, directory) as (stdout, stderr):
        ready = stdout.wait_for(READY.match, 300)  # it may have to build first
        assert ready, stderr.text()
        said_before = stdout.lines()[:stdout.lines().index(ready)]
        assert any("ldapsearch" in line for line in said_before)
        assert [mode(directory / name) for name in MADE] == [0o600] * len(MADE)
        made = contents(directory)
        port = int(READY.match(ready).group("port"))
        found = subprocess.run(
            ["ldapsearch", "-x", "-H", "ldap://127.0.0.1:%d" % port, "-D", "cn=root", "-y",
             directory / "admin.pw", "-b", "cn=configuration"], stdout=subprocess.PIPE,
            timeout=programs.DEADLINE, check=True)
        assert b"orv-slapdAdminPW" in found.stdout

    with serve(script, directory) as (stdout, stderr):
        assert stdout.wait_for(READY.match), stderr.text()
    assert contents(directory) == made


def hold_lock(path):
    """As a build that runs holds it, for as long as the file is open."""
    file = path.open("w", encoding="utf-8")
    fcntl.flock(file, fcntl.LOCK_EX | fcntl.LOCK_NB)
    return file


def test_serve_does_not_wait_for_the_build_of_another_preset(tmp_path):
    root = copied_scripts(tmp_path / "copy")
    with hold_lock(root / "build/.lock-asan"), hold_lock(root / "build/.lock"), \
            serve(root / "serve", tmp_path / "var") as (stdout, stderr):
        assert stdout.wait_for(READY.match), stderr.text()


def test_serve_waits_for_a_build_of_its_own_tree_and_says_so(tmp_path):
    root = copied_scripts(tmp_path / "copy")
    lock = hold_lock(root / "build/.lock-dev")
    with serve(root / "serve", tmp_path / "var") as (stdout, stderr):
        assert stderr.wait_for(lambda line: "waiting for another build" in line)
        assert stdout.lines() == []
        lock.close()
        assert stdout.wait_for(READY.match), stderr.text()
