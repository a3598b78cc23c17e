"""LDAP clients: python3-ldap in this process, ldap-utils in others."""

import io
import os
import subprocess

import ldap
import ldif

from .config_file import dn_key
from .programs import DEADLINE

BASE = "cn=configuration"
ADMINISTRATOR = "cn=root"

# No client may read settings of the machine it happens to run on.
os.environ["LDAPNOINIT"] = "1"


def connect(instance):
    """A connection that has not bound."""
    client = ldap.initialize(instance.url)
    client.protocol_version = ldap.VERSION3
    client.set_option(ldap.OPT_REFERRALS, 0)
    client.set_option(ldap.OPT_NETWORK_TIMEOUT, DEADLINE)
    client.set_option(ldap.OPT_TIMEOUT, DEADLINE)
    return client


def bind(instance, who=ADMINISTRATOR, password=None):
    """A connection bound as `who`, by default as the primary administrator."""
    client = connect(instance)
    client.simple_bind_s(who, instance.password if password is None else password)
    return client


def answer_of(operation, *arguments, **more):
    """The code and the text of an operation's result as python3-ldap reports them; 0 and "" for
    success."""
    try:
        operation(*arguments, **more)
        return 0, ""
    except ldap.LDAPError as error:
        return error.args[0]["result"], error.args[0].get("info", "")


def code_of(operation, *arguments, **more):
    return answer_of(operation, *arguments, **more)[0]


def bind_code(instance, who, password):
    client = connect(instance)
    try:
        return code_of(client.simple_bind_s, who, password)
    finally:
        client.unbind_s()


def search(client, base=BASE, scope=ldap.SCOPE_SUBTREE, filter_text="(objectClass=*)",
           attributes=None, types_only=0):
    """The entries as a dictionary from comparable DN to attributes."""
    found = client.search_s(base, scope, filter_text, attributes, types_only)
    entries = {dn_key(dn): values for dn, values in found}
    assert len(entries) == len(found), "an entry came twice"
    return entries


def names(client, filter_text, base=BASE, scope=ldap.SCOPE_SUBTREE):
    """The comparable DNs of the entries that match a filter."""
    return set(search(client, base, scope, filter_text, ["1.1"]))


def read(client, dn, attributes=None):
    """The attributes of one entry."""
    return search(client, dn, ldap.SCOPE_BASE, "(objectClass=*)", attributes)[dn_key(dn)]


def command(program, instance, *arguments, who=ADMINISTRATOR):
    """Runs one of ldap-utils; as the primary administrator, or anonymously with `who=None`."""
    login = ["-D", who, "-y", str(instance.directory / "admin.pw")] if who else []
    return subprocess.run(
        [program, "-x", "-H", instance.url, *login, *arguments], stdout=subprocess.PIPE,
        stderr=subprocess.PIPE, timeout=DEADLINE, env={**os.environ, "LDAPNOINIT": "1"},
        check=False)


class _Collector(ldif.LDIFParser):
    def __init__(self, text):
        super().__init__(io.BytesIO(text))
        self.entries = {}
        self.parse_entry_records()

    def handle(self, dn, entry):
        assert dn_key(dn) not in self.entries, "an entry came twice"
        self.entries[dn_key(dn)] = entry


def parse_ldif(text):
    """LDIF as a dictionary from comparable DN to attributes."""
    return _Collector(text).entries
