"""Entries to add, and how changes of the configuration are looked at from outside."""

import difflib
import re

import ldap
import ldap.modlist

from . import programs
from .clients import answer_of, code_of

PASSWORD = "Vx7#kq9!Zp3$"  # passes the policy of the default configuration

GROUP = "cn=admingroup,cn=configuration"
LOGS = "cn=log management,cn=configuration"
PLACE = "cn=schemas,cn=configuration"  # where nothing is protected


def member(name, bind_dn=None, password=PASSWORD, roles=None, **more):
    """The DN and the attributes of a member of the administrative group."""
    attributes = {
        "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"],
        "cn": [name], "orv-slapdAdminDN": [bind_dn or "cn=" + name],
        "orv-slapdAdminPW": [password]}
    if roles:
        attributes["orv-slapdAdminRole"] = list(roles)
    for name_of_more, value in more.items():
        attributes["orv-slapd" + name_of_more] = [value]
    return "cn=%s,%s" % (name, GROUP), attributes


def supplier(name, bind_dn=None, kind="orv-slapdSupplier", dn=None):
    return dn or "cn=%s,cn=replication,cn=configuration" % name, {
        "objectClass": ["top", "orv-slapdConfigEntry", kind], "cn": [name],
        "orv-slapdMasterDN": [bind_dn or "cn=%s supplier" % name],
        "orv-slapdMasterPW": [PASSWORD]}


def pass_through(name, *subtrees, url="ldap://ldap.example.com:389"):
    return "cn=%s,cn=passthrough authentication,cn=configuration" % name, {
        "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdPta"], "cn": [name],
        "orv-slapdPtaURL": [url], "orv-slapdPtaSubtree": list(subtrees)}


def container(name, parent=PLACE, **more):
    attributes = {"objectClass": ["top", "container"], "cn": [name]}
    attributes.update(more)
    return "cn=%s,%s" % (name, parent), attributes


def encoded(attributes):
    """As python3-ldap wants it."""
    return [(name, [value if isinstance(value, bytes) else value.encode() for value in values])
            for name, values in attributes.items()]


def add(client, dn, attributes):
    """The result code of an add. `attributes` is a dictionary, or a list of (name, values)."""
    pairs = attributes if isinstance(attributes, list) else encoded(attributes)
    return code_of(client.add_s, dn, pairs)


def delete(client, dn):
    return code_of(client.delete_s, dn)


def modify(client, dn, *modifications):
    """The result code of a modify of (operation, type, values); values as texts, or None."""
    return refusal(client, dn, *modifications)[0]


def refusal(client, dn, *modifications):
    """The code and the text of the result."""
    as_bytes = [(operation, name, values and [
        value if isinstance(value, bytes) else value.encode() for value in values])
        for operation, name, values in modifications]
    return answer_of(client.modify_s, dn, as_bytes)


def added(name, *values):
    return ldap.MOD_ADD, name, list(values)


def deleted(name, *values):
    return ldap.MOD_DELETE, name, list(values) or None


def replaced(name, *values):
    return ldap.MOD_REPLACE, name, list(values) or None


def difference(before, after):
    """The lines that a change took out and put in, in their order, as from a version control."""
    removed, added = [], []
    matcher = difflib.SequenceMatcher(None, before.splitlines(), after.splitlines(),
                                      autojunk=False)
    for kind, begin, end, new_begin, new_end in matcher.get_opcodes():
        if kind != "equal":
            removed += before.splitlines()[begin:end]
            added += after.splitlines()[new_begin:new_end]
    return removed, added


def numbers_of_classes():
    """The numeric OIDs of the server's own object classes and attribute types, by their names."""
    text = (programs.SOURCE_DIR / "schema" / "orv.schema").read_text()
    text += (programs.SOURCE_DIR / "schema" / "core.schema").read_text()
    found = {}
    for oid, names in re.findall(r"\(\s*([\d.]+)\s+NAME\s+(\(.*?\)|'[^']*')", text):
        for name in re.findall(r"'([^']*)'", names):
            found[name] = oid
    return found
