"""What "cmake --install" puts somewhere serves from there, and from wherever it is moved."""

import os
import subprocess

import pytest

from orv_e2e import clients, programs
from orv_e2e.instance import Instance

BUILD_DIR = programs.bin_dir().parent
# The files that packaging/README.md names.
FILES = {"bin/orvd", "bin/orvcfg", "lib/libcfg.so", "lib/libslapi.so", "lib/libback-config.so",
         "share/orv/orvd.cat", "share/man/man8/orvd.8", "share/man/man1/orvcfg.1",
         "share/doc/orv/README.md", "share/doc/orv/CHANGELOG.md", "share/doc/orv/LICENSE",
         "share/doc/orv/configuration.md", "lib/systemd/system/orvd.service",
         "lib/sysusers.d/orv.conf"}


@pytest.fixture(scope="module", name="prefix")
def prefix_fixture(tmp_path_factory):
    """An installation that was moved after it was made."""
    made = tmp_path_factory.mktemp("installed") / "made"
    subprocess.run(["cmake", "--install", BUILD_DIR, "--prefix", made], check=True,
                   stdout=subprocess.PIPE, timeout=programs.DEADLINE)
    return made.rename(made.with_name("moved"))


def test_installation_holds_what_the_page_on_packaging_names(prefix):
    found = {str(path.relative_to(prefix)) for path in prefix.rglob("*") if not path.is_dir()}
    assert found == FILES


@pytest.mark.parametrize("name", ["bin/orvd", "bin/orvcfg", "lib/libback-config.so"])
def test_no_library_is_looked_for_in_the_build_or_the_current_folder(prefix, name):
    dynamic = subprocess.run(["readelf", "-d", prefix / name], check=True, text=True,
                             stdout=subprocess.PIPE, timeout=programs.DEADLINE).stdout
    path = dynamic.partition("runpath: [")[2].partition("]")[0]
    assert path and all(part.startswith("$ORIGIN") for part in path.split(":"))


def test_installed_server_serves_with_its_own_libraries(prefix, tmp_path, monkeypatch):
    monkeypatch.setenv("ORV_BIN_DIR", str(prefix / "bin"))
    instance = Instance.create(tmp_path / "instance")
    instance.start(environment={"LD_DEBUG": "libs"})
    client = clients.bind(instance)
    assert clients.BASE in clients.search(client)
    client.unbind_s()
    instance.stop()
    loaded = [os.path.realpath(line.partition("calling init: ")[2])
              for line in instance.stderr.lines() if "calling init: " in line]
    for library in ["libcfg.so", "libslapi.so", "libback-config.so"]:
        assert [path for path in loaded if path.endswith("/" + library)] == [
            os.path.realpath(prefix / "lib" / library)]
