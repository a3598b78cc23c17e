"""Fixtures of the end-to-end tests."""

import locale
import os
import pathlib
import sys
import tempfile

import pytest

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent))

from orv_e2e import clients  # noqa: E402
from orv_e2e.instance import Instance  # noqa: E402


def _finish(instance):
    """Stops what still runs; a daemon that does not end with 0 fails the test."""
    instance.stop()


@pytest.fixture
def instance(tmp_path):
    """A fresh instance that does not run yet."""
    made = Instance.create(tmp_path / "instance")
    yield made
    _finish(made)


@pytest.fixture
def server(instance):
    """A fresh instance that runs with its default configuration."""
    return instance.start()


@pytest.fixture
def root(server):
    """A client of `server` bound as the primary administrator."""
    client = clients.bind(server)
    yield client
    client.unbind_s()


@pytest.fixture(scope="module")
def module_instance(tmp_path_factory):
    """A fresh instance, not running, shared by the tests of one file."""
    made = Instance.create(tmp_path_factory.mktemp("shared") / "instance")
    yield made
    _finish(made)


@pytest.fixture
def open_folder():
    """A folder that other users of the host can pass through: pytest closes those of tmp_path."""
    with tempfile.TemporaryDirectory(prefix="orv-") as made:
        os.chmod(made, 0o711)
        yield pathlib.Path(made)


@pytest.fixture(scope="session", autouse=True)
def _plain_environment():
    """No setting of the machine reaches the clients or the daemon."""
    for name in [name for name in os.environ if name.startswith("LDAP") and name != "LDAPNOINIT"]:
        del os.environ[name]
    os.environ["LDAPNOINIT"] = "1"


@pytest.fixture(scope="session", autouse=True)
def _locale_of_the_environment():
    """Where one is named, it has to be there: without its files the tests would run under "C"."""
    if "LOCPATH" in os.environ:
        kept = locale.setlocale(locale.LC_CTYPE)
        locale.setlocale(locale.LC_CTYPE, "")
        locale.setlocale(locale.LC_CTYPE, kept)
