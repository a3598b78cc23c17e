"""What the first start makes, and that the second start leaves it alone."""

import re
import stat
import subprocess

import pytest

from orv_e2e import clients, programs
from orv_e2e.instance import READY, Instance
from orv_e2e.output import LineCollector

MADE = ["config.ldif", "key.stash", "admin.pw"]


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
    assert [mode(directory / name) for name in MADE] == [0o600] * 3
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


def test_port_and_address_of_the_file_hold_without_options(instance):
    with clients_port() as port:
        instance.config.set(clients.BASE, "orv-slapdPort", str(port))
    command = [str(programs.orvd()), "--config", str(instance.config.path), "--key-stash",
               str(instance.key_stash)]
    instance._spawn(command, None)  # pylint: disable=protected-access
    instance._wait_until_ready()  # pylint: disable=protected-access
    assert instance.url == "ldap://127.0.0.1:%d" % port


class clients_port:  # pylint: disable=invalid-name
    """A port that was free a moment ago."""

    def __enter__(self):
        import socket  # pylint: disable=import-outside-toplevel
        self.socket = socket.socket()
        self.socket.bind(("127.0.0.1", 0))
        return self.socket.getsockname()[1]

    def __exit__(self, *_):
        self.socket.close()


SERVE = programs.SOURCE_DIR / "serve"


def serve(directory):
    """Runs ./serve, which starts the daemon in its place, and waits for the ready line."""
    process = subprocess.Popen(
        [SERVE, "--dir", directory, "--port", "0"], stdin=subprocess.DEVNULL,
        stdout=subprocess.PIPE, stderr=subprocess.PIPE, cwd=directory.parent, start_new_session=True)
    stdout, stderr = LineCollector(process.stdout), LineCollector(process.stderr)
    ready = stdout.wait_for(READY.match, 300)
    assert ready, stderr.text()
    return process, stdout, int(READY.match(ready).group("port"))


@pytest.mark.skipif(programs.bin_dir() != programs.SOURCE_DIR / "build/dev/bin",
                    reason="./serve would build another tree than the one under test")
def test_serve_makes_an_instance_once_and_serves_it(tmp_path):
    directory = tmp_path / "var"
    process, stdout, port = serve(directory)
    try:
        ready = [bool(READY.match(line)) for line in stdout.lines()].index(True)
        assert any("ldapsearch" in line for line in stdout.lines()[:ready])
        assert [mode(directory / name) for name in MADE] == [0o600] * 3
        made = contents(directory)
        found = subprocess.run(
            ["ldapsearch", "-x", "-H", "ldap://127.0.0.1:%d" % port, "-D", "cn=root", "-y",
             directory / "admin.pw", "-b", "cn=configuration"], stdout=subprocess.PIPE,
            timeout=programs.DEADLINE, check=True)
        assert b"orv-slapdAdminPW" in found.stdout
    finally:
        process.terminate()
    assert process.wait(programs.DEADLINE) == 0

    process, _, _ = serve(directory)
    process.terminate()
    assert process.wait(programs.DEADLINE) == 0
    assert contents(directory) == made
