"""probe.py HOST PORT PASSWORD-FILE PAUSE: searches as an administrator until a line comes in, then
prints when, how long in milliseconds, and with which code, as JSON. From time to time it also comes
anew, and flushes a page to the disk itself: what a change waits for, and searches behind it."""

import json
import os
import pathlib
import select
import sys
import time

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parents[2] / "tests" / "e2e"))

from orv_e2e import wire  # noqa: E402

EVERY = 10
PAGE = b"x" * 4096


class Server:
    def __init__(self, host, port):
        self.host, self.port = host, int(port)


def timed(action):
    began = time.monotonic()
    code = action()
    return began, (time.monotonic() - began) * 1000, code


def main():
    host, port, password_file, pause = sys.argv[1:]
    server = Server(host, port)
    password = pathlib.Path(password_file).read_text(encoding="utf-8")
    standing = wire.Wire(server)
    assert standing.bind("cn=root", password) == 0

    def newcomer():
        with wire.Wire(server) as client:
            return client.bind("cn=root", password) or client.search(2)[0]

    file = os.open(password_file + ".probe", os.O_RDWR | os.O_CREAT, 0o600)

    def floor():
        os.pwrite(file, PAGE, 0)
        os.fsync(file)
        return 0

    found = {"searches": [], "newcomers": [], "floors": []}
    number = 1
    while not select.select([sys.stdin], [], [], float(pause))[0]:
        number += 1
        found["searches"].append(timed(lambda: standing.search(number)[0]))
        if number % EVERY == 0:
            found["newcomers"].append(timed(newcomer))
            found["floors"].append(timed(floor))
    json.dump(found, sys.stdout)


if __name__ == "__main__":
    main()
