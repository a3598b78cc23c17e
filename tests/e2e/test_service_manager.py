"""The daemon under a service manager: notices, sockets that were opened for it, and the unit."""

import os
import pathlib
import re
import shutil
import signal
import socket
import subprocess
import time

import ldap
import pytest

from orv_e2e import clients, programs, service, users


@pytest.fixture(name="notices")
def notices_fixture(tmp_path):
    made = service.Notices(tmp_path)
    yield made
    made.close()


# ---- notices

def test_manager_hears_when_the_server_is_ready_reloads_and_stops(instance, notices):
    instance.start(environment={"NOTIFY_SOCKET": notices.path})
    ready = notices.next()
    assert ready["READY"] == "1" and ready["STATUS"].startswith("Serving " + instance.url)
    clients.bind(instance).unbind_s()
    before = time.monotonic_ns() // 1000
    instance.process.send_signal(signal.SIGHUP)
    reloading = notices.next()
    assert reloading["RELOADING"] == "1"
    assert before <= int(reloading["MONOTONIC_USEC"]) <= time.monotonic_ns() // 1000
    assert notices.next()["READY"] == "1"
    instance.process.send_signal(signal.SIGTERM)
    assert notices.next()["STOPPING"] == "1"
    instance.assert_ended_in_order()


def test_manager_is_reached_under_a_name_outside_the_file_system(instance):
    name = "orv-test-%d" % os.getpid()
    with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as abstract:
        abstract.bind("\0" + name)
        abstract.settimeout(programs.DEADLINE)
        instance.start(environment={"NOTIFY_SOCKET": "@" + name})
        assert abstract.recv(4096).startswith(b"READY=1\n")


def test_server_that_does_not_start_is_never_ready(instance, notices):
    instance.config.path.chmod(0o644)
    instance.start_refused(environment={"NOTIFY_SOCKET": notices.path})
    notices.socket.setblocking(False)
    with pytest.raises(BlockingIOError):
        notices.next()


def test_manager_that_is_not_there_is_told_of_and_no_reason_not_to_serve(instance, tmp_path):
    instance.start(environment={"NOTIFY_SOCKET": str(tmp_path / "nobody")})
    instance.stderr.wait_for(lambda line: "cannot reach the service manager at NOTIFY_SOCKET=" in line)


def test_server_is_alive_as_often_as_the_watchdog_wants(instance, notices):
    instance.start(environment={"NOTIFY_SOCKET": notices.path, "WATCHDOG_USEC": "200000"})
    for _ in range(3):
        assert notices.wait_for("WATCHDOG") == {"WATCHDOG": "1"}


def test_watchdog_of_another_process_is_none_of_ours(instance, notices):
    instance.start(environment={"NOTIFY_SOCKET": notices.path, "WATCHDOG_USEC": "20000",
                                "WATCHDOG_PID": "1"})
    assert "READY" in notices.next()
    instance.stop()
    assert "STOPPING" in notices.next()


# ---- sockets that were opened for it

def test_server_serves_at_the_sockets_that_it_is_given(instance, tmp_path):
    path = tmp_path / "given"
    with service.listening() as clear, service.listening() as secure, \
            service.listening(socket.AF_UNIX, str(path)) as local:
        wrapper, numbers = service.handing_over([local, secure, clear], "ldapi:ldaps:ldap")
        ports = clear.getsockname()[1], secure.getsockname()[1]
        instance.start(wrapper=wrapper, descriptors=numbers)
    serves = instance.stderr.wait_for(lambda line: " serves " in line).split(" at ")[1].split()
    assert set(serves) == {"ldap://127.0.0.1:%d" % ports[0], "ldaps://127.0.0.1:%d" % ports[1],
                           "ldapi://" + str(path).replace("/", "%2F")}
    instance.port = ports[0]
    clients.bind(instance).unbind_s()
    over_tls = ldap.initialize("ldaps://127.0.0.1:%d" % ports[1])
    over_tls.set_option(ldap.OPT_X_TLS_CACERTFILE, str(instance.certificate))
    over_tls.set_option(ldap.OPT_X_TLS_NEWCTX, 0)
    over_tls.simple_bind_s("cn=root", instance.password)
    local_client = ldap.initialize("ldapi://" + str(path).replace("/", "%2F"))
    local_client.simple_bind_s("", "")
    instance.stop()
    assert path.exists()  # it is the manager's


def test_first_url_is_that_of_the_port_in_clear(instance):
    with service.listening() as secure, service.listening() as clear:
        wrapper, numbers = service.handing_over([secure, clear], "ldaps:ldap")
        instance.start(wrapper=wrapper, descriptors=numbers)
        assert instance.port == clear.getsockname()[1]


def test_local_socket_alone_leaves_the_ports_to_the_configuration(instance, tmp_path):
    path = tmp_path / "given"
    with service.listening(socket.AF_UNIX, str(path)) as local:
        wrapper, numbers = service.handing_over([local], "ldapi")
        instance.start(wrapper=wrapper, descriptors=numbers)
    clients.bind(instance).unbind_s()
    assert not (instance.directory / "ldapi").exists()
    assert instance.local_url == "ldapi://" + str(path).replace("/", "%2F")


def open_to_all(path):
    made = service.listening(socket.AF_UNIX, str(path))
    path.chmod(0o666)
    return made


def without_a_path():
    return service.listening(socket.AF_UNIX, "")


@pytest.mark.parametrize("make", [open_to_all, lambda _: without_a_path()])
def test_local_socket_that_every_user_may_connect_to_is_refused(instance, tmp_path, make):
    with make(tmp_path / "given") as local:
        wrapper, numbers = service.handing_over([local], "ldapi")
        code, told = instance.start_refused(wrapper=wrapper, descriptors=numbers)
    assert code == 1 and "set SocketMode=0600 and SocketUser= to the user of the server" in told


def test_more_sockets_than_can_be_taken_over_are_refused(instance):
    with service.listening() as clear:
        wrapper, numbers = service.handing_over([clear] * 65, ":".join(["ldap"] * 65))
        code, told = instance.start_refused(wrapper=wrapper, descriptors=numbers)
    assert code == 1 and "more than 64 sockets are handed over (LISTEN_FDS)" in told


@users.needs_root
def test_sockets_are_given_to_another_user(open_folder):
    made = users.instance_of(open_folder / "instance")
    with service.listening() as clear:
        wrapper, numbers = service.handing_over([clear], "ldap")
        made.start(*users.options(), wrapper=wrapper, descriptors=numbers)
    clients.bind(made).unbind_s()
    made.stop()


def datagrams():
    made = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
    made.bind(("127.0.0.1", 0))
    return made


def silent():
    made = socket.socket()
    made.bind(("127.0.0.1", 0))
    return made


class NoSocket:
    """A file in place of a socket."""

    def __init__(self):
        self.file = open("/dev/null", "rb")

    def fileno(self):
        return self.file.fileno()

    def close(self):
        self.file.close()


@pytest.mark.parametrize("make, name, text", [
    (service.listening, "http", "is not named ldap, ldaps or ldapi (FileDescriptorName=)"),
    (service.listening, "-", "is not named ldap, ldaps or ldapi (FileDescriptorName=)"),
    (service.listening, "ldapi", "is not of the family that its name says"),
    (lambda: service.listening(socket.AF_UNIX, ""), "ldaps", "is not of the family"),
    (datagrams, "ldap", "is no stream socket (ListenStream=)"),
    (silent, "ldap", "does not listen (Accept=no)"),
    (NoSocket, "ldap", "is no socket"),
])
def test_sockets_that_cannot_be_used_are_refused(instance, make, name, text):
    made = make()
    wrapper, numbers = service.handing_over([made], name)
    code, told = instance.start_refused(wrapper=wrapper, descriptors=numbers)
    made.close()
    assert code == 1 and "the inherited descriptor 3" in told and text in told


def test_socket_for_tls_without_a_certificate_is_refused(instance):
    group = "cn=admingroup,cn=configuration"
    for name in ("orv-slapdTlsCertificateFile", "orv-slapdTlsKeyFile"):
        instance.config.set(group, name)
    with service.listening() as secure:
        wrapper, numbers = service.handing_over([secure], "ldaps")
        code, told = instance.start_refused(wrapper=wrapper, descriptors=numbers)
    assert code == 1 and "there is a socket for TLS, but orv-slapdTlsCertificateFile" in told


@users.needs_root  # of a process that nobody may look into
def test_sockets_meant_for_another_process_are_closed(instance):
    with service.listening() as other:
        wrapper, numbers = service.handing_over([other], "ldap", pid_offset=1)
        instance.start(wrapper=wrapper, descriptors=numbers)
        assert instance.port != other.getsockname()[1]
        inode = "socket:[%d]" % os.fstat(other.fileno()).st_ino
        assert inode not in service.descriptors_of(instance.process.pid).values()


# ---- what else is inherited

@users.needs_root
def test_other_descriptors_are_closed_and_standard_input_is_empty(instance, tmp_path):
    with open(tmp_path / "open", "wb") as other:
        instance.start(descriptors=[other.fileno()])
    found = service.descriptors_of(instance.process.pid)
    assert str(tmp_path / "open") not in found.values()
    assert found[0] == "/dev/null"
    assert os.readlink("/proc/%d/cwd" % instance.process.pid) == "/"


@users.needs_root
def test_environment_of_whoever_started_it_is_gone(instance, notices):
    marker = "Marker-5c1e-environment"
    instance.start(environment={"ORV_TEST_TOKEN": marker, "NOTIFY_SOCKET": notices.path, "TZ": "UTC",
                                "AUTOLOCKTYPE": "REGULARLOCK"})
    environment = pathlib.Path("/proc/%d/environ" % instance.process.pid).read_bytes()
    assert marker.encode() not in environment
    assert b"TZ=UTC" in environment
    assert b"AUTOLOCKTYPE=REGULARLOCK" in environment


def test_blocked_and_ignored_signals_of_whoever_started_it_do_not_matter(instance):
    instance.start(wrapper=["env", "--ignore-signal=HUP", "--ignore-signal=TERM",
                            "--block-signal=TERM", "--block-signal=HUP"])
    instance.process.send_signal(signal.SIGHUP)
    instance.stderr.wait_for(lambda line: "settings taken over" in line)
    instance.stop()


def test_every_thread_is_restricted_to_the_calls_it_needs(server):
    threads = users.status_of_threads(server.process.pid)
    if programs.sanitized():
        server.stderr.wait_for(lambda line: "not restricted: a sanitizer is built in" in line)
    else:
        assert {thread["Seccomp"][0] for thread in threads} == {"2"}
        server.stderr.wait_for(lambda line: line.endswith("info system calls are restricted"))


def test_restriction_can_be_left_out(instance):
    instance.start("--without-call-filter")
    threads = users.status_of_threads(instance.process.pid)
    assert {thread["Seccomp"][0] for thread in threads} == {"0"}
    instance.stderr.wait_for(lambda line: "system calls are not restricted, as" in line)


# ---- the unit

needs_analysis = pytest.mark.skipif(shutil.which("systemd-analyze") is None,
                                    reason="systemd-analyze is not installed")


@pytest.fixture(scope="module", name="unit")
def unit_fixture(tmp_path_factory):
    prefix = tmp_path_factory.mktemp("unit") / "prefix"
    subprocess.run(["cmake", "--install", programs.bin_dir().parent, "--prefix", prefix], check=True,
                   stdout=subprocess.PIPE, timeout=programs.DEADLINE)
    return prefix / "lib" / "systemd" / "system" / "orvd.service"


def test_unit_starts_the_installed_server(unit):
    command = re.search(r"^ExecStart=(\S+)", unit.read_text(), re.MULTILINE).group(1)
    assert pathlib.Path(command) == unit.parents[3] / "bin" / "orvd"
    assert os.access(command, os.X_OK)


def analyze(*arguments):
    return subprocess.run(["systemd-analyze", "--no-pager", *arguments], text=True, check=False,
                          stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                          timeout=programs.DEADLINE)


@needs_analysis
def test_unit_is_understood(unit):
    result = analyze("verify", "--man=no", str(unit))
    about_it = [line for line in result.stdout.splitlines() if "orvd.service" in line]
    assert result.returncode == 0 and not about_it, result.stdout


def lines_of(unit, name):
    return re.findall("^%s=(.*)$" % name, unit.read_text(), re.MULTILINE)


def test_unit_waits_for_the_addresses_of_the_host(unit):
    assert lines_of(unit, "Wants") == ["network-online.target"]
    assert "network-online.target" in lines_of(unit, "After")[0].split()


def test_unit_starts_again_for_as_long_as_it_takes(unit):
    assert lines_of(unit, "Restart") == ["on-failure"]
    # The manager gives up after 5 starts within 10 seconds, unless the unit says otherwise.
    assert int(lines_of(unit, "RestartSec")[0]) > 10 / 5
    assert not lines_of(unit, "StartLimit[A-Za-z]*")


def test_unit_lets_nothing_be_executed_that_the_server_can_write(unit):
    settings = dict(re.findall(r"^(\w+)=(.*)$", unit.read_text(), re.MULTILINE))
    assert settings["ProtectSystem"] == "strict" and settings["PrivateTmp"] == "yes"
    assert "ReadWritePaths" not in settings and "RuntimeDirectory" not in settings
    assert set(settings["NoExecPaths"].split()) == {
        "%S/" + settings["StateDirectory"], "%L/" + settings["LogsDirectory"], "/tmp", "/var/tmp",
        "-/dev/shm"}


@needs_analysis
def test_unit_leaves_little_exposed(unit):
    result = analyze("security", "--offline=yes", "--threshold=20", str(unit))
    assert result.returncode == 0, result.stdout
