"""Edits a configuration file as an administrator would with a text editor: by its text."""

import base64
import os
import re

MEMBER_CLASSES = ["top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"]


def dn_key(dn):
    """A spelling of a plain DN (no escapes) under which equal DNs are equal."""
    return ",".join(part.strip().lower() for part in dn.split(","))


def ldif_line(name, value):
    """One attribute line; base64 only where RFC 2849 asks for it, bytes otherwise as they are."""
    if isinstance(value, str):
        value = value.encode("utf-8")
    unsafe = (value[:1] in (b" ", b":", b"<") or value[-1:] == b" " or b"\n" in value
              or b"\r" in value or b"\0" in value)
    if unsafe:
        return name.encode() + b":: " + base64.b64encode(value) + b"\n"
    return name.encode() + b": " + value + b"\n"


def record(dn, attributes):
    """The text of a record. `attributes` is a list of (name, value or list of values)."""
    lines = [ldif_line("dn", dn)]
    for name, values in attributes:
        for value in values if isinstance(values, (list, tuple)) else [values]:
            lines.append(ldif_line(name, value))
    return b"".join(lines)


class ConfigFile:
    """The file at `path`. Every change puts a whole new file in its place."""

    def __init__(self, path):
        self.path = path

    def read(self):
        return self.path.read_bytes()

    def replace(self, content):
        """Puts `content` in place atomically, with the mode of the file before."""
        mode = self.path.stat().st_mode & 0o7777 if self.path.is_file() else 0o600
        temporary = self.path.with_name(self.path.name + ".edit")
        temporary.write_bytes(content)
        os.chmod(temporary, mode)
        os.replace(temporary, self.path)

    def append(self, content):
        text = self.read()
        self.replace(text + (b"" if text.endswith(b"\n") else b"\n") + b"\n" + content)

    def add(self, dn, attributes):
        self.append(record(dn, attributes))

    def remove(self, dn):
        lines = self.read().splitlines(keepends=True)
        first, last = self._record(lines, dn)
        self.replace(b"".join(lines[:first] + lines[last:]))

    def set(self, dn, name, *values):
        """Makes `values` the values of an attribute of an entry; none removes it."""
        lines = self.read().splitlines(keepends=True)
        first, last = self._record(lines, dn)
        kept = []
        dropping = False
        for line in lines[first:last]:
            if line[:1] == b" ":
                if not dropping:
                    kept.append(line)
                continue
            dropping = line.split(b":", 1)[0].strip().lower() == name.lower().encode()
            if not dropping:
                kept.append(line)
        kept += [ldif_line(name, value) for value in values]
        self.replace(b"".join(lines[:first] + kept + lines[last:]))

    def line_of(self, dn):
        """The number, from 1, of the line with an entry's DN."""
        return self._record(self.read().splitlines(keepends=True), dn)[0] + 1

    def add_member(self, name, password, roles=("SchemaAdmin",), bind_dn=None):
        """Adds a member of the administrative group and returns the DN it binds with."""
        bind_dn = bind_dn or "cn=" + name
        self.add("cn=%s,cn=admingroup,cn=configuration" % name,
                 [("objectClass", MEMBER_CLASSES), ("cn", name), ("orv-slapdAdminDN", bind_dn),
                  ("orv-slapdAdminPW", password), ("orv-slapdAdminRole", list(roles))])
        return bind_dn

    @staticmethod
    def _record(lines, dn):
        """The half-open range of lines of an entry, comments inside it included."""
        for number, line in enumerate(lines):
            match = re.match(rb"dn: *(.*?)\r?\n?$", line, re.IGNORECASE)
            if match and dn_key(match.group(1).decode()) == dn_key(dn):
                end = number + 1
                while end < len(lines) and lines[end].strip():
                    end += 1
                return number, end
        raise KeyError(dn)
