"""A realm of Kerberos with a key distribution centre of its own, on loopback."""

import os
import pathlib
import signal
import subprocess
import time

from .programs import DEADLINE

REALM = "EXAMPLE.COM"
# Where Debian keeps programs of administrators, which is not in everybody's path.
PATH = os.environ.get("PATH", "") + ":/usr/sbin:/sbin"

CLIENT = """[libdefaults]
 default_realm = {realm}
 dns_lookup_kdc = false
 dns_lookup_realm = false
 dns_canonicalize_hostname = false
 rdns = false
 udp_preference_limit = 1
[realms]
 {realm} = {{
  kdc = 127.0.0.1:{port}
 }}
"""

CENTRE = """[kdcdefaults]
 kdc_listen = ""
 kdc_tcp_listen = 127.0.0.1:0
[realms]
 {realm} = {{
  database_name = {folder}/principal
  key_stash_file = {folder}/stash
  acl_file = {folder}/acl
 }}
"""


def _listening_port(pid):
    """The TCP port that a process listens at, or None."""
    inodes = set()
    for entry in pathlib.Path("/proc/%d/fd" % pid).iterdir():
        try:
            target = os.readlink(entry)
        except OSError:
            continue
        if target.startswith("socket:["):
            inodes.add(target[len("socket:["):-1])
    for line in pathlib.Path("/proc/net/tcp").read_text().splitlines()[1:]:
        fields = line.split()
        if fields[3] == "0A" and fields[9] in inodes:
            return int(fields[1].split(":")[1], 16)
    return None


class Realm:
    """Runs until `stop`. Nothing of it is outside its folder."""

    def __init__(self, folder):
        self.folder = pathlib.Path(folder)
        self.folder.mkdir()
        self.environment = {
            **os.environ, "PATH": PATH, "KRB5_CONFIG": str(self.folder / "krb5.conf"),
            "KRB5_KDC_PROFILE": str(self.folder / "kdc.conf"),
            "KRB5RCACHENAME": "file2:%s/replays" % self.folder}
        (self.folder / "kdc.conf").write_text(CENTRE.format(realm=REALM, folder=self.folder))
        (self.folder / "krb5.conf").write_text(CLIENT.format(realm=REALM, port=1))
        (self.folder / "acl").write_text("")
        self._run("kdb5_util", "create", "-s", "-P", "master", "-r", REALM)
        self.process = subprocess.Popen(
            ["krb5kdc", "-n"], env=self.environment, stdin=subprocess.DEVNULL,
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, start_new_session=True)
        port = self._wait_for_port()
        (self.folder / "krb5.conf").write_text(CLIENT.format(realm=REALM, port=port))

    def _wait_for_port(self):
        end = time.monotonic() + DEADLINE
        while time.monotonic() < end and self.process.poll() is None:
            port = _listening_port(self.process.pid)
            if port:
                return port
            time.sleep(0.01)
        self.stop()
        raise AssertionError("krb5kdc does not listen")

    def _run(self, *command, **more):
        subprocess.run(command, check=True, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                       timeout=DEADLINE, env={**self.environment, **more})

    def stop(self):
        if self.process.poll() is None:
            self.process.send_signal(signal.SIGTERM)
            self.process.wait(DEADLINE)

    def keytab(self, principal, name=None):
        """A file with the keys of a principal, which is made when there is none."""
        path = self.folder / (name or principal.replace("/", "_") + ".keytab")
        self._run("kadmin.local", "-r", REALM, "-q", "addprinc -randkey " + principal)
        self._run("kadmin.local", "-r", REALM, "-q", "ktadd -k %s %s" % (path, principal))
        path.chmod(0o600)
        return path

    def ticket(self, user):
        """The environment of somebody who has just logged in as that user."""
        cache = str(self.folder / (user.replace("/", "_") + ".cache"))
        self._run("kinit", "-k", "-t", str(self.keytab(user)), user, KRB5CCNAME=cache)
        return {**self.environment, "KRB5CCNAME": cache}


def with_kerberos(instance, keytab, name="orv-kn=admin@EXAMPLE.COM"):
    """Has the keytab and the primary administrator's Kerberos identity in the file."""
    instance.config.append(
        ("\ndn: CN=KERBEROS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: orv-slapdConfigEntry\n"
         "objectClass: orv-slapdKerberos\ncn: Kerberos\norv-slapdKrbAdminDN: %s\n" % name).encode())
    text = instance.config.path.read_text()
    instance.config.path.write_text(text.replace(
        "\ncn: AdminGroup\n", "\ncn: AdminGroup\norv-slapdKrbKeytab: %s\n" % keytab))
