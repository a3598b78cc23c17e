"""Who may modify what: every kind of caller and every set of roles, against every protected entry and
every attribute that a rule names.

What is expected comes from orv_e2e/authority.py. A modify that is refused leaves the file as it was,
byte for byte; one that is done is taken back by putting the file of before in its place.
"""

import itertools
import os
import subprocess

import pytest

from orv_e2e import authority, changes, clients, programs
from orv_e2e.authority import (ADD, BACKENDS, DELETE, DIRECTORY, GROUP, LOGS, MASTER_SERVER,
                               PASS_THROUGH, POLICY, REPLACE, TOP, Caller)
from orv_e2e.config_file import MEMBER_CLASSES

PASSWORD = "in the open 1"
NEW_PASSWORD = "Qm4&wt8?Lb6%"
OF_THE_SUPPLIER = "o=of the supplier"

CONFIG = "orv-slapdConfigEntry"
OTHER_MEMBER = "cn=bystander," + GROUP
OWN = "the caller's own entry"
MISSING = "cn=missing,cn=schemas," + TOP


def log_entry(name, kind="orv-slapdLogSettings"):
    return {"objectClass": ["top", CONFIG, kind], "cn": [name]}


def member_entry(name, roles, password=PASSWORD):
    return {"objectClass": MEMBER_CLASSES, "cn": [name], "orv-slapdAdminDN": ["cn=" + name],
            "orv-slapdAdminPW": [password], "orv-slapdAdminRole": list(roles)}


def supplier_entry(name, kind="orv-slapdSupplier", **more):
    made = {"objectClass": ["top", CONFIG, kind], "cn": [name],
            "orv-slapdMasterDN": ["cn=binds as " + name], "orv-slapdMasterPW": [PASSWORD]}
    return {**made, **{"orv-slapd" + key: [value] for key, value in more.items()}}


def container_entry(name):
    return {"objectClass": ["top", "container"], "cn": [name]}


# Entries that the default configuration lacks.
ADDED = {
    OTHER_MEMBER: member_entry("bystander", ["SchemaAdmin"]),
    "cn=kerberos," + TOP: {"objectClass": ["top", CONFIG, "orv-slapdKerberos"],
                           "cn": ["kerberos"], "orv-slapdKrbAdminDN": ["orv-kn=root@EXAMPLE.COM"]},
    MASTER_SERVER: supplier_entry("master server", "orv-slapdReplication"),
    "cn=here,cn=replication," + TOP: supplier_entry("here"),
    "cn=elsewhere,cn=schemas," + TOP: supplier_entry("elsewhere"),
    "cn=feeder,cn=replication," + TOP: supplier_entry("feeder", MasterSuffix=OF_THE_SUPPLIER),
    "cn=partner," + PASS_THROUGH: {
        "objectClass": ["top", CONFIG, "orv-slapdPta"], "cn": ["partner"],
        "orv-slapdPtaURL": ["ldap://ldap.example.com:389"], "orv-slapdPtaSubtree": ["o=partner"]},
    "cn=part,cn=proxydb,cn=proxy backends," + BACKENDS: {
        "objectClass": ["top", CONFIG, "orv-slapdProxySplit"], "cn": ["part"],
        "orv-slapdProxySplitName": ["part1"]},
    "cn=ordinary,cn=schemas," + TOP: container_entry("ordinary"),
}

TARGETS = [
    TOP, GROUP, OWN, OTHER_MEMBER, "cn=missing," + GROUP, "cn=kerberos," + TOP, "cn=digest," + TOP,
    POLICY, "cn=log management," + TOP, "cn=audit," + LOGS, "cn=admin audit," + LOGS,
    "cn=default," + LOGS, "cn=access," + LOGS, "cn=replication," + TOP, MASTER_SERVER,
    "cn=here,cn=replication," + TOP, "cn=elsewhere,cn=schemas," + TOP, PASS_THROUGH,
    "cn=partner," + PASS_THROUGH, BACKENDS, DIRECTORY, "cn=configdb,cn=config backends," + BACKENDS,
    "cn=part,cn=proxydb,cn=proxy backends," + BACKENDS, "cn=ordinary,cn=schemas," + TOP, MISSING]


# ---- callers

def role_sets():
    for count in range(len(authority.ROLE_BITS) + 1):
        yield from itertools.combinations(authority.ROLE_BITS, count)


# The sets of roles of the rules, and what else a file may hold: roles that open nothing here, all
# of them, and "NoAdmin" beside others, which takes them away.
ROLE_SETS = {"with " + (" and ".join(roles) or "none"): roles or ("PasswordAdmin",)
             for roles in role_sets()}
ROLE_SETS["with all"] = (*authority.ROLE_BITS, "DirDataAdmin", "PasswordAdmin",
                         "ServerStartStopAdmin")
ROLE_SETS["with NoAdmin beside others"] = (*authority.ROLE_BITS, "NoAdmin")
if programs.sanitized():  # and slow: one role each, those of suppliers, and none after all
    ROLE_SETS = {name: roles for name, roles in ROLE_SETS.items()
                 if len(roles) == 1 or "NoAdmin" in roles
                 or roles == ("ReplicationAdmin", "SchemaAdmin", "ServerConfigGroupMember")}

PRIMARY, STRANGER = "primary administrator", "stranger"
OF_SERVER, OF_SUFFIX = "supplier of the server", "supplier of a suffix"

CALLERS = {PRIMARY: Caller(authority.PRIMARY), STRANGER: Caller(authority.STRANGER),
           OF_SERVER: Caller(authority.SERVER_SUPPLIER),
           OF_SUFFIX: Caller(authority.SUFFIX_SUPPLIER, suffixes=(OF_THE_SUPPLIER,))}
for _name, _roles in ROLE_SETS.items():
    CALLERS[_name] = Caller(authority.MEMBER, authority.bits_of(_roles),
                            "cn=%s,%s" % (_name.lower(), GROUP))

LOGINS = {OF_SERVER: ("cn=binds as master server", PASSWORD),
          OF_SUFFIX: ("cn=binds as feeder", PASSWORD)}


# ---- modifications

def innocent_values(folder):
    """A value of each attribute that no rule has anything against, whatever the file holds."""
    return {
        "description": "changed", "orv-slapdAdminDN": "cn=fresh", "orv-slapdAdminPW": NEW_PASSWORD,
        "orv-slapdAdminGroupEnabled": "TRUE", "orv-slapdAdminRole": "DirDataAdmin",
        "orv-slapdKrbAdminDN": "orv-kn=fresh@EXAMPLE.COM", "orv-slapdDigestAdminUser": "fresh",
        "orv-slapdMasterDN": "cn=fresh supplier", "orv-slapdMasterPW": NEW_PASSWORD,
        "orv-slapdMasterSuffix": "o=fresh", "orv-slapdProxySplitName": "fresh1",
        "orv-slapdPtaURL": "ldap://other.example.com", "orv-slapdPtaSubtree": "o=fresh",
        "orv-slapdLog": str(folder / "log" / "fresh.log"), "orv-slapdLogLevel": "info",
        "orv-slapdIpAddress": "127.0.0.1", "orv-slapdPwEncryption": "AES256",
        "orv-slapdPwEncryptionAllowed": "AES256", "orv-slapdSizeLimit": "1000",
        "orv-slapdSuffix": OF_THE_SUPPLIER, "pwdMinLength": "12"}


def lists_of_modifications(folder):
    values = innocent_values(folder)
    for name, value in values.items():
        yield [(REPLACE, name, [value])]
        yield [(ADD, name, [value])]
        yield [(DELETE, name, None)]
    password = (REPLACE, "orv-slapdAdminPW", [NEW_PASSWORD])
    describe = (REPLACE, "description", ["changed"])
    suffix = (ADD, "orv-slapdSuffix", [OF_THE_SUPPLIER])
    yield [password, describe]
    yield [describe, password]
    yield [password, password]
    yield [(DELETE, "orv-slapdAdminPW", [PASSWORD]), (ADD, "orv-slapdAdminPW", [NEW_PASSWORD])]
    yield [suffix, describe]
    yield [suffix, (ADD, "orv-slapdSuffix", ["o=another"])]
    yield [(ADD, "orv-slapdSuffix", ["o=another"])]
    yield [(DELETE, "orv-slapdAdminRole", ["SchemaAdmin"])]
    yield [(DELETE, "orv-slapdAdminRole", ["ReplicationAdmin"])]
    yield [describe, (DELETE, "orv-slapdAdminRole", None)]
    yield [(ADD, "description", ["one"]), (REPLACE, "description", ["two"])]
    yield [(ADD, "description", ["one"]), (DELETE, "description", ["one"])]
    yield [(REPLACE, "cn", ["renamed"])]
    yield [(DELETE, "cn", None)]
    yield [(ADD, "objectClass", ["orv-slapdAdminGroupSettings"])]
    yield [(ADD, "objectClass", ["orv-slapdSupplier"])]
    yield [(DELETE, "objectClass", ["top"])]
    yield [(REPLACE, "orv-slapdSizeLimit", ["-1"])]
    yield [(REPLACE, "orv-slapdLogLevel", ["loud"])]
    yield [(REPLACE, "orv-restartSettings", ["orv-slapdPort"])]
    yield [(REPLACE, "noSuchType", ["x"])]
    yield [(REPLACE, "description;lang-en", ["x"])]


# ---- the server under test

class Matrix:
    """An instance with all entries and callers, and a client for each of them."""

    def __init__(self, instance):
        self.instance = instance
        for dn, attributes in ADDED.items():
            instance.config.add(dn, list(attributes.items()))
        for name, roles in ROLE_SETS.items():
            instance.config.add(CALLERS[name].entry,
                                list(member_entry(name.lower(), roles).items()))
        instance.config.set("cn=digest," + TOP, "orv-slapdDigestAdminUser", "root")
        self.text = instance.config.read()
        self.entries = {dn: {name: [value.decode() for value in values]
                             for name, values in attributes.items() if name in authority.KNOWN}
                        for dn, attributes in clients.parse_ldif(self.text).items()}
        self.clients = {}

    def bind(self, name):
        if name in self.clients:
            self.clients.pop(name).unbind_s()
        login = LOGINS.get(name, ("cn=" + name.lower(), PASSWORD))
        if name == STRANGER:
            self.clients[name] = clients.connect(self.instance)
        elif name == PRIMARY:
            self.clients[name] = clients.bind(self.instance)
        else:
            self.clients[name] = clients.bind(self.instance, *login)

    def bind_all(self):
        for name in CALLERS:
            self.bind(name)

    def attempt(self, name, dn, modifications):
        """The code, or what else is wrong; afterwards everything is as before."""
        code = changes.modify(self.clients[name], dn, *modifications)
        text = self.instance.config.read()
        if code != 0:
            return code if text == self.text else "%d, but the file was changed" % code
        self.instance.config.replace(self.text)
        if self._concerns_callers(dn, modifications):
            self.bind_all()
        return code if clients.parse_ldif(text).keys() == self.entries.keys() else "entries differ"

    @staticmethod
    def _concerns_callers(dn, modifications):
        """Whether somebody may have been disconnected."""
        types = {name for _, name, _ in modifications}
        return (dn in (TOP, GROUP, MASTER_SERVER) or authority.in_group(dn)) and not (
            types <= {"description", "orv-slapdSizeLimit", "orv-slapdIpAddress"})


@pytest.fixture(scope="module", name="matrix")
def matrix_fixture(module_instance):
    made = Matrix(module_instance)
    module_instance.start()
    made.bind_all()
    yield made
    for client in made.clients.values():
        client.unbind_s()


def entry_for(target, caller):
    return caller.entry if target == OWN else target


@pytest.mark.parametrize("target", TARGETS)
def test_every_caller_modifies_what_the_rules_let_it(matrix, target):
    wrong = {}
    asked = 0
    for name, caller in CALLERS.items():
        dn = entry_for(target, caller)
        if not dn:
            continue
        for modifications in lists_of_modifications(matrix.instance.directory):
            wanted = authority.expected(caller, dn, matrix.entries.get(dn), modifications)
            code = matrix.attempt(name, dn, modifications)
            asked += 1
            if code != wanted:
                wrong[name, str(modifications)] = (code, "expected", wanted)
    print("%d outcomes" % asked)
    assert not wrong, "\n".join("%s %s: %s" % (*key, value) for key, value in wrong.items())


def test_ldapmodify_meets_the_same_rules(matrix, tmp_path):
    """Another client, one modification of each entry by each caller of the table of roles."""
    password = tmp_path / "password"
    password.write_text(PASSWORD)
    password.chmod(0o600)
    change = [(REPLACE, "description", ["changed"])]
    for name, roles in ROLE_SETS.items():
        if len(roles) not in (1, 3):
            continue
        for target in TARGETS:
            dn = entry_for(target, CALLERS[name])
            ldif = tmp_path / "change.ldif"
            ldif.write_text("dn: %s\nchangetype: modify\nreplace: description\n"
                            "description: changed\n" % dn)
            done = subprocess.run(
                ["ldapmodify", "-x", "-H", matrix.instance.url, "-D", "cn=" + name.lower(), "-y",
                 str(password), "-f", str(ldif)], stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                timeout=programs.DEADLINE, check=False, env={**os.environ, "LDAPNOINIT": "1"})
            wanted = authority.expected(CALLERS[name], dn, matrix.entries.get(dn), change)
            assert done.returncode == wanted, (name, dn, done.stderr)
            assert (matrix.instance.config.read() == matrix.text) == (wanted != 0)
            matrix.instance.config.replace(matrix.text)
