"""Certificates for the tests, made with openssl."""

import subprocess

from .programs import DEADLINE


def _openssl(*arguments):
    subprocess.run(["openssl", *[str(argument) for argument in arguments]], check=True,
                   stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, timeout=DEADLINE)


class Authority:
    """An authority in a folder, and the pairs that it signs."""

    def __init__(self, folder):
        self.folder = folder
        folder.mkdir(mode=0o755)
        self.certificate, self.key = self._paths("ca")
        _openssl("req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "2", "-subj",
                 "/O=Orv Tests/CN=Authority", "-keyout", self.key, "-out", self.certificate)
        self.key.chmod(0o600)
        self.certificate.chmod(0o644)  # whatever the umask

    def _paths(self, name):
        return self.folder / (name + ".crt"), self.folder / (name + ".key")

    def pair(self, name, subject=None, days=2, names="DNS:localhost,IP:127.0.0.1"):
        """The paths of a certificate and its key."""
        certificate, key = self._paths(name)
        request, extensions = self.folder / "request", self.folder / "extensions"
        extensions.write_text("subjectAltName=%s\n" % names)
        _openssl("req", "-new", "-newkey", "rsa:2048", "-nodes", "-subj",
                 subject or "/O=Orv Tests/CN=" + name, "-keyout", key, "-out", request)
        _openssl("x509", "-req", "-in", request, "-CA", self.certificate, "-CAkey", self.key,
                 "-CAcreateserial", "-days", str(days), "-extfile", extensions, "-out", certificate)
        key.chmod(0o600)
        return certificate, key

    def revocations(self, *certificates):
        """The path of the list of these and of all that were revoked before, in PEM."""
        database, rules, result = (self.folder / name for name in ("index", "rules", "ca.crl"))
        database.touch()
        rules.write_text("[ca]\ndefault_ca=own\n[own]\ndatabase=%s\ndefault_md=sha256\n"
                         "default_crl_days=1\n" % database)
        own = ["ca", "-config", rules, "-cert", self.certificate, "-keyfile", self.key]
        for certificate in certificates:
            _openssl(*own, "-revoke", certificate)
        _openssl(*own, "-gencrl", "-out", result)
        result.chmod(0o644)
        return result
