"""A log is never written into a file that is something else."""

import os

import pytest

from orv_e2e import clients

ERROR_LOG = "cn=default,cn=log management,cn=configuration"
ACCESS_LOG = "cn=access,cn=log management,cn=configuration"


def refusals(instance):
    return [line for line in instance.stderr.lines() if "cannot log to" in line]


@pytest.mark.parametrize("name", ["config.ldif", "key.stash", "admin.pw", "tls.key"])
@pytest.mark.parametrize("linked", [False, True])
def test_log_in_a_file_of_the_instance_is_refused(instance, name, linked):
    target = instance.directory / name
    if linked:
        target = instance.directory / "log" / "alias"
        os.link(instance.directory / name, target)
    instance.config.set(ERROR_LOG, "orv-slapdLog", str(target))
    if linked and name == "config.ldif":
        target.unlink()
        os.link(instance.config.path, target)
    before = (instance.directory / name).read_bytes()
    instance.start()
    clients.bind(instance)
    instance.stop()
    assert len(refusals(instance)) == 1
    assert (instance.directory / name).read_bytes() == before


# What a change of the configuration file leaves beside it, and uses on the way.
COMPANIONS = [".save", ".save.new", ".lock", ".new", ".swap", ".rescued"]


@pytest.mark.parametrize("log", [ERROR_LOG, ACCESS_LOG])
@pytest.mark.parametrize("ending", COMPANIONS)
def test_log_in_place_of_a_companion_that_is_not_there_is_refused_and_not_made(instance, log,
                                                                                ending):
    target = instance.directory / ("config.ldif" + ending)
    instance.config.set(log, "orv-slapdLog", str(target))
    instance.start()
    instance.stop()
    assert len(refusals(instance)) == 1
    assert not target.exists()


@pytest.mark.parametrize("ending", ["", *COMPANIONS])
def test_companions_stand_where_the_configuration_really_is(instance, ending):
    real = instance.directory / "real"
    real.mkdir()
    target = real / ("settings.ldif" + ending)
    instance.config.set(ACCESS_LOG, "orv-slapdLog", str(target))
    instance.config.path.rename(real / "settings.ldif")
    instance.config.path.symlink_to(real / "settings.ldif")
    before = (real / "settings.ldif").read_bytes()
    instance.start()
    root = clients.bind(instance)
    clients.search(root)
    root.unbind_s()
    instance.stop()
    assert len(refusals(instance)) == 1
    assert not ending or not target.exists()
    assert (real / "settings.ldif").read_bytes() == before


def test_both_logs_in_one_file_are_refused(instance):
    shared = instance.directory / "log" / "shared.log"
    instance.config.set(ERROR_LOG, "orv-slapdLog", str(shared))
    instance.config.set(ACCESS_LOG, "orv-slapdLog", str(shared))
    instance.start()
    clients.bind(instance)
    instance.stop()
    text = shared.read_text()
    assert "cannot log to" in text
    assert "conn=" not in text


def test_log_in_the_trace_file_is_refused(instance):
    trace = instance.directory / "trace.log"
    instance.config.set(ACCESS_LOG, "orv-slapdLog", str(trace))
    instance.start("--trace-file", str(trace))
    instance.stop()
    assert len(refusals(instance)) == 1


@pytest.mark.parametrize("name", ["config.ldif", "key.stash", "admin.pw"])
def test_trace_into_a_file_of_the_instance_is_refused_at_start(instance, name):
    path = instance.directory / name
    before = path.read_bytes()
    exit_code, stderr = instance.start_refused("--trace-mask", "0x04030000", "--trace-file",
                                               str(path))
    assert exit_code == 1
    assert "the same file as" in stderr
    assert path.read_bytes() == before
