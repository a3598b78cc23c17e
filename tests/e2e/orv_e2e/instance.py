"""An instance of the server: its folder, its process, its end."""

import os
import pathlib
import re
import signal
import subprocess

from . import programs
from .config_file import ConfigFile
from .output import LineCollector

READY = re.compile(r"^orvd ready ldap://(?P<host>[^:]+|\[[^\]]+\]):(?P<port>\d+)$")


class StartRefused(Exception):
    """The daemon ended before it was ready."""

    def __init__(self, exit_code, stderr):
        super().__init__("orvd ended with %d:\n%s" % (exit_code, stderr))
        self.exit_code = exit_code
        self.stderr = stderr


class Instance:
    """A folder made by `orvcfg init` and at most one daemon serving it on a port of its own."""

    def __init__(self, directory):
        self.directory = pathlib.Path(directory)
        self.config = ConfigFile(self.directory / "config.ldif")
        self.key_stash = self.directory / "key.stash"
        self.access_log = self.directory / "log" / "access.log"
        self.host = None
        self.port = None
        self.stdout = None
        self.stderr = None
        self.process = None

    @classmethod
    def create(cls, directory):
        subprocess.run([programs.orvcfg(), "init", "--dir", directory], check=True,
                       stdout=subprocess.PIPE, timeout=programs.DEADLINE)
        return cls(directory)

    @property
    def url(self):
        return "ldap://%s:%d" % (self.host, self.port)

    @property
    def secure_url(self):
        return self._listener("ldaps")

    @property
    def secure_port(self):
        return int(self.secure_url.rsplit(":", 1)[1])

    @property
    def local_url(self):
        return self._listener("ldapi")

    def _listener(self, kind):
        line = self.stderr.wait_for(lambda text: " serves " in text)
        return re.search(kind + r"://\S+", line).group()

    @property
    def certificate(self):
        return self.directory / "tls.crt"

    @property
    def password(self):
        return (self.directory / "admin.pw").read_text()

    def command(self, *options):
        return [str(programs.orvd()), "--config", str(self.config.path), "--key-stash",
                str(self.key_stash), "--port", "0", *options]

    def start(self, *options, environment=None, wrapper=(), descriptors=()):
        """Starts the daemon and returns when it accepts connections."""
        assert self.process is None, "already running"
        self._spawn([*wrapper, *self.command(*options)], environment, descriptors)
        return self._wait_until_ready()

    def start_refused(self, *options, environment=None, wrapper=(), descriptors=()):
        """Starts a daemon that has to refuse; gives its exit status and its standard error."""
        try:
            self.start(*options, environment=environment, wrapper=wrapper, descriptors=descriptors)
        except StartRefused as refusal:
            return refusal.exit_code, refusal.stderr
        self.stop()
        raise AssertionError("the daemon started")

    def _spawn(self, command, environment, descriptors=()):
        self.process = subprocess.Popen(
            command, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
            env={**os.environ, **(environment or {})}, start_new_session=True,
            pass_fds=descriptors)
        self.stdout = LineCollector(self.process.stdout)
        self.stderr = LineCollector(self.process.stderr)

    def _wait_until_ready(self):
        try:
            line = self.stdout.wait_for(READY.match)
        except AssertionError:
            self.kill()
            raise
        if line is None:
            exit_code = self.process.wait(programs.DEADLINE)
            self.stderr.finish()
            self._forget()
            raise StartRefused(exit_code, self.stderr.text())
        match = READY.match(line)
        self.host, self.port = match.group("host"), int(match.group("port"))
        return self

    def stop(self, with_signal=signal.SIGTERM):
        """Stops the daemon and asserts that it went in order."""
        if self.process is None:
            return
        self.process.send_signal(with_signal)
        self.assert_ended_in_order()

    def assert_ended_in_order(self):
        try:
            exit_code = self.process.wait(programs.DEADLINE)
        except subprocess.TimeoutExpired:
            self.kill()
            raise AssertionError("orvd did not stop; it wrote:\n" + self.stderr.text()) from None
        self.stderr.finish()
        self._forget()
        assert exit_code == 0, "orvd ended with %d:\n%s" % (exit_code, self.stderr.text())

    def kill(self):
        """The way out after a failure."""
        if self.process is not None:
            self.process.kill()
            self.process.wait()
            self._forget()

    def _forget(self):
        self.process = None
