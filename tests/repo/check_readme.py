"""Runs the commands of README.md, as a new user would.

Every block marked "sh" is executed in its order, from the top of the repository; "./serve" is kept
running until the end, and must print its ready line first. Where the repository holds an instance
already, or the port is taken, a temporary directory and a free port stand in for "var" and 3389, so
that nobody's instance is touched.
"""

import os
import re
import shutil
import signal
import socket
import subprocess
import sys
import tempfile

import findings

BLOCK = re.compile(r"^```sh\n(.*?)^```$", re.MULTILINE | re.DOTALL)
# These run this check themselves.
RUN_ELSEWHERE = {"./test", ".ci/run"}
FIRST_BUILD_SECONDS = 1800
# What the commands have to print, besides ending well.
EXPECTED = {
    "the configuration tree": "dn: CN=CONFIGURATION",
    "the change of a setting": 'modifying entry "cn=configuration"',
    "a search that meets the changed limit": "result: 4 Size limit exceeded",
    "the change of a member's own password":
        'modifying entry "cn=alice,cn=admingroup,cn=configuration"',
    "what the member reads with it": "dn: cn=alice,CN=ADMINGROUP,CN=CONFIGURATION",
    "the check of the file": "nothing wrong",
}


def commands(text):
    return [line.strip() for block in BLOCK.findall(text) for line in block.splitlines()
            if line.strip() and not line.startswith("#")]


def port_is_free(port):
    with socket.socket() as probe:
        probe.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
        try:
            probe.bind(("127.0.0.1", port))
        except OSError:
            return False
    return True


class Place:
    """Where the commands run: as written, or with another directory and port."""

    def __init__(self, source):
        self.source = source
        self.as_written = (not os.path.exists(os.path.join(source, "var"))
                           and port_is_free(3389) and port_is_free(3636))
        self.folder = os.path.join(source, "var")
        if not self.as_written:
            self.folder = os.path.join(tempfile.mkdtemp(), "instance")
        self.port = "3389"

    def command(self, line):
        if self.as_written:
            return line
        if line.split()[0] == "./serve":
            return f"{line} --dir {self.folder} --port 0"
        return re.sub(r"\bvar/", self.folder + "/", line).replace("3389", self.port)

    def clean(self):
        shutil.rmtree(self.folder if self.as_written else os.path.dirname(self.folder),
                      ignore_errors=True)


def too_late(*_):
    raise SystemExit(f"the server was not ready after {FIRST_BUILD_SECONDS} s")


def start(place, line):
    """Starts "./serve" and waits for the ready line, which also tells the port."""
    server = subprocess.Popen(["bash", "-c", "exec " + place.command(line)], cwd=place.source,
                              stdout=subprocess.PIPE, text=True, stdin=subprocess.DEVNULL)
    signal.signal(signal.SIGALRM, too_late)
    signal.alarm(FIRST_BUILD_SECONDS)
    for output in server.stdout:
        ready = re.match(r"orvd ready ldap://.*:(\d+)$", output)
        if ready:
            place.port = ready.group(1)
            signal.alarm(0)
            return server
    raise SystemExit(f"{line}: ended with {server.wait()} before it was ready")


def stop(server, found):
    server.send_signal(signal.SIGTERM)
    if server.wait(timeout=60) != 0:
        found.append(f"./serve: ended with {server.returncode} after SIGTERM")


def run(place, line, found):
    result = subprocess.run(["bash", "-c", place.command(line)], cwd=place.source, text=True,
                            capture_output=True, stdin=subprocess.DEVNULL, timeout=600)
    if result.returncode != 0:
        found.append(f"{line}: ended with {result.returncode}\n{result.stdout}{result.stderr}")
    return result.stdout


def unseen(output):
    return [f"README.md: no command printed {what} ({text})"
            for what, text in EXPECTED.items() if text.lower() not in output.lower()]


def main():
    options = findings.arguments(__doc__)
    lines = commands(findings.read(options.source, "README.md"))
    place, server, found = Place(options.source), None, []
    output = ""
    try:
        for line in lines:
            if line.split()[0] in RUN_ELSEWHERE:
                continue
            if line.split()[0] == "./serve" and "--build-only" not in line:
                server = start(place, line)
            else:
                output += run(place, line, found)
    finally:
        if server:
            stop(server, found)
        place.clean()
    found += unseen(output)
    findings.conclude(found, f"commands of README.md ({len(lines)})")


if __name__ == "__main__":
    sys.exit(main())
