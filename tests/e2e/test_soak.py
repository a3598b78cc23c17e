"""bench/soak in its short form: everybody at once for some seconds, and a small crowd.

ORV_SOAK_SECONDS: how long each of them goes on (default 4). ORV_SOAK_CROWD: how many connections
the crowd has (default 400)."""

import os
import subprocess
import sys

from orv_e2e import programs

SECONDS = os.environ.get("ORV_SOAK_SECONDS", "4")
CROWD = os.environ.get("ORV_SOAK_CROWD", "400")


def soak(*options):
    done = subprocess.run(
        [sys.executable, str(programs.SOURCE_DIR / "bench" / "soak"), "--no-build", "--build-dir",
         str(programs.bin_dir().parent), "--seconds", SECONDS, *options], stdout=subprocess.PIPE,
        stderr=subprocess.STDOUT, timeout=float(SECONDS) + 20 * programs.DEADLINE, check=False)
    text = done.stdout.decode()
    print(text)
    assert done.returncode == 0, text
    return text


def test_all_operations_bad_clients_and_edits_at_once_lose_nothing():
    text = soak("--connections", "60", "--pause", "0.05")
    for deed in ("changes answered with 0", "connections over start-tls", "nuisance: stall",
                 "notices heard", "edits"):
        assert deed in text, deed


def test_administrator_is_served_while_a_crowd_stands_half_of_it_slow_or_silent():
    text = soak("--crowd", CROWD)
    assert "%s connections" % CROWD in text
