"""The same tour of a server with three libraries that people use, each under StartTLS and at the
port for TLS. tours/expected.txt is what every one of them prints."""

import difflib
import os
import pathlib
import shutil
import subprocess
import sys

import pytest

from orv_e2e.certificates import Authority
from orv_e2e.changes import GROUP
from orv_e2e.programs import DEADLINE

TOURS = pathlib.Path(__file__).resolve().parent / "tours"

# A library that has to be compiled or loaded first may take its time on a busy machine.
SECONDS = 6 * DEADLINE

LIBRARIES = {
    "java": ["java", "-Dfile.encoding=UTF-8", "-XX:TieredStopAtLevel=1", "-XX:+UseSerialGC",
             str(TOURS / "Tour.java")],
    "perl": ["perl", str(TOURS / "tour.pl")],
    "python": [sys.executable, str(TOURS / "tour.py")],
}

# What succeeds where a library is there.
THERE = {
    "java": ["javac", "-version"],
    "perl": ["perl", "-MNet::LDAP", "-MIO::Socket::SSL", "-e", "1"],
    "python": ["true"],
}


def is_there(library):
    if not shutil.which(THERE[library][0]):
        return False
    return subprocess.run(THERE[library], stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL,
                          timeout=SECONDS, check=False).returncode == 0


@pytest.fixture(name="two_addresses")
def two_addresses_fixture(instance):
    """A server that can be reached at an address that its certificate does not name, too, and that
    takes passwords under TLS only."""
    instance.config.set(GROUP, "orv-slapdTlsForLocalPasswords", "TRUE")
    return instance.start("--address", "127.0.0.1", "--address", "127.0.0.2")


@pytest.mark.parametrize("transport", ["start-tls", "ldaps"])
@pytest.mark.parametrize("library", LIBRARIES)
def test_tour_of_a_library_shows_what_is_expected(two_addresses, tmp_path, library, transport):
    if "CI" not in os.environ and not is_there(library):
        pytest.skip("packages.txt names what is needed, under clients")
    server = two_addresses
    port = server.secure_port if transport == "ldaps" else server.port
    stranger = Authority(tmp_path / "stranger").certificate
    done = subprocess.run(
        [*LIBRARIES[library], transport, str(port), str(server.certificate), str(stranger),
         str(server.directory / "admin.pw")], stdout=subprocess.PIPE, stderr=subprocess.PIPE,
        timeout=SECONDS, check=False, env={**os.environ, "PYTHONIOENCODING": "utf-8"})
    expected = (TOURS / "expected.txt").read_text(encoding="utf-8")
    difference = "\n".join(difflib.unified_diff(
        expected.splitlines(), done.stdout.decode().splitlines(), "expected.txt", library,
        lineterm=""))
    assert not difference, difference + "\n" + done.stderr.decode()
    assert (done.returncode, done.stderr) == (0, b"")
