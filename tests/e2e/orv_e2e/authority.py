"""Who may modify what, and what else stands in the way: a model of the rules of docs/changing.md and
docs/guards.md, written from the rules and not from the code under test.

It knows no file and no protocol. Its entries are dictionaries from types to lists of values; what
its tables do not name does not exist for it. A modification is (operation, type, values); values is
None where there are none.
"""

import dataclasses

import ldap

ADD, DELETE, REPLACE = ldap.MOD_ADD, ldap.MOD_DELETE, ldap.MOD_REPLACE

PRIMARY, MEMBER, STRANGER = "primary", "member", "stranger"
SERVER_SUPPLIER, SUFFIX_SUPPLIER = "supplier of the server", "supplier of a suffix"

AUDIT, REPLICATION_OF_SERVER, REPLICATION_OF_SUFFIX, SCHEMA, SERVER = 0x02, 0x04, 0x08, 0x10, 0x20
ANY_ROLE = 0x3E
ROLE_BITS = {"AuditAdmin": AUDIT, "ReplicationAdmin": REPLICATION_OF_SERVER | REPLICATION_OF_SUFFIX,
             "SchemaAdmin": SCHEMA, "ServerConfigGroupMember": SERVER}

TOP = "cn=configuration"
GROUP = "cn=admingroup," + TOP
LOGS = "cn=log management," + TOP
BACKENDS = "cn=orv directory,cn=schemas," + TOP
DIRECTORY = "cn=directory,cn=rdbm backends," + BACKENDS
MASTER_SERVER = "cn=master server," + TOP
POLICY = "cn=pwdpolicy admin," + TOP
PASS_THROUGH = "cn=passthrough authentication," + TOP

# Entries for which it does not take the role ServerConfigGroupMember alone: one of these bits.
OWN_BITS = {
    "cn=audit," + LOGS: AUDIT,
    "cn=admin audit," + LOGS: AUDIT,
    "cn=default," + LOGS: AUDIT | SERVER,
    "cn=replication," + TOP: REPLICATION_OF_SERVER | REPLICATION_OF_SUFFIX | SERVER,
    BACKENDS: SCHEMA | SERVER,
}

# What the classes allow and demand, as far as the tests use it; "cn" is everybody's.
CLASSES = {
    "container": {"description"},
    "orv-slapdConfigEntry": {"description"},
    "orv-slapdTop": {"orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdAdminGroupEnabled",
                     "orv-slapdIpAddress", "orv-slapdPwEncryption", "orv-slapdSizeLimit"},
    "orv-slapdAdminGroupMember": {"orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdAdminRole",
                                  "orv-slapdKrbAdminDN", "orv-slapdDigestAdminUser"},
    "orv-slapdAdminGroupSettings": {"orv-slapdPwEncryptionAllowed"},
    "orv-slapdKerberos": {"orv-slapdKrbAdminDN"},
    "orv-slapdDigest": {"orv-slapdDigestAdminUser"},
    "orv-slapdReplication": {"orv-slapdMasterDN", "orv-slapdMasterPW"},
    "orv-slapdSupplier": {"orv-slapdMasterDN", "orv-slapdMasterPW", "orv-slapdMasterSuffix"},
    "orv-slapdPta": {"orv-slapdPtaURL", "orv-slapdPtaSubtree"},
    "orv-auditConfig": {"orv-slapdLog", "orv-slapdLogLevel"},
    "orv-slapdLogSettings": {"orv-slapdLog", "orv-slapdLogLevel"},
    "orv-slapdAdminPolicy": {"pwdMinLength"},
    "orv-slapdBackendEntry": {"orv-slapdSuffix"},
    "orv-slapdProxySplit": {"orv-slapdProxySplitName"},
    "orv-slapdReplicationSettings": set(),
    "top": set(),
}
MANDATORY = {
    "orv-slapdTop": {"orv-slapdAdminDN"},
    "orv-slapdAdminGroupMember": {"orv-slapdAdminDN", "orv-slapdAdminRole"},
    "orv-slapdKerberos": {"orv-slapdKrbAdminDN"},
    "orv-slapdReplication": {"orv-slapdMasterDN"},
    "orv-slapdSupplier": {"orv-slapdMasterDN"},
    "orv-slapdPta": {"orv-slapdPtaURL", "orv-slapdPtaSubtree"},
    "orv-slapdProxySplit": {"orv-slapdProxySplitName"},
}
AUXILIARY = {"orv-slapdAdminGroupSettings"}
MULTI_VALUED = {"cn", "objectClass", "description", "orv-slapdAdminRole", "orv-slapdIpAddress",
                "orv-slapdSuffix", "orv-slapdPtaSubtree", "orv-slapdMasterSuffix",
                "orv-slapdPwEncryptionAllowed"}
SECRET = {"orv-slapdAdminPW", "orv-slapdMasterPW"}
ONLY_THE_SERVER_SETS = {"orv-restartSettings"}
UNKNOWN = {"noSuchType", "description;lang-en"}

KNOWN = {"cn", "objectClass"}.union(*CLASSES.values())


@dataclasses.dataclass(frozen=True)
class Caller:
    """Somebody who is bound, or nobody."""
    kind: str
    bits: int = 0
    entry: str = ""          # of a member: its own
    suffixes: tuple = ()     # of a supplier of suffixes


def bits_of(roles):
    if "NoAdmin" in roles:
        return 0
    return sum(ROLE_BITS.get(role, 0) for role in roles)


def in_group(dn):
    return dn == GROUP or dn.endswith("," + GROUP)


# ---- the server, in front of the backend

def sent_as_it_is(caller, dn):
    """Lists that are not folded: where the number of modifications is itself a rule."""
    return (caller.kind in (SERVER_SUPPLIER, SUFFIX_SUPPLIER)
            or caller.kind == MEMBER and in_group(dn))


def unspeakable(modifications):
    for _, name, _ in modifications:
        if name in UNKNOWN:
            return 17
        if name in ONLY_THE_SERVER_SETS:
            return 19
    return 0


def class_change(modifications):
    for operation, name, values in modifications:
        if name == "objectClass":
            if operation == REPLACE or not values or not set(values) <= AUXILIARY:
                return 69
    return 0


def unfoldable(modifications):
    """53 for a value both added and deleted, and for a replace behind single values."""
    touched = {}
    for operation, name, values in modifications:
        added, deleted = touched.setdefault(name, (set(), set()))
        if operation == REPLACE or not values:
            if added or deleted:
                return 53
            continue
        same, other = (added, deleted) if operation == ADD else (deleted, added)
        if set(values) & other:
            return 53
        same.update(values)
    return 0


def folded(modifications):
    """For each type in the order of first appearance what is added, and behind that what is
    deleted; a replace stays, since nothing that comes here has anything behind one."""
    types = list(dict.fromkeys(name for _, name, _ in modifications))
    made = []
    for name in types:
        of_type = [m for m in modifications if m[1] == name]
        if any(operation == REPLACE or not values for operation, _, values in of_type):
            made.append(of_type[-1])
            continue
        for operation in (ADD, DELETE):
            values = [value for m in of_type if m[0] == operation for value in m[2]]
            if values:
                made.append((operation, name, values))
    return made


def takes_name_away(dn, modifications):
    held = dn.split(",")[0].split("=")[1]
    for operation, name, values in modifications:
        given = [value.lower() for value in values or []]
        if name == "cn" and (operation == REPLACE and held not in given or operation == DELETE and (
                not given or held in given)):
            return 67
    return 0


def guarded(dn, modifications):
    for operation, name, values in modifications:
        for value in values or []:
            if operation == DELETE:
                continue
            if (name, value) == ("objectClass", "orv-slapdAdminGroupSettings") and dn != GROUP:
                return 53
            if name == "orv-slapdSizeLimit" and int(value) < 0:
                return 19
            if name == "orv-slapdLogLevel" and value not in ("off", "info"):
                return 19
    return 0


def first_of(*checks):
    for check in checks:
        if code := check():
            return code
    return 0


# ---- the schema

def changed(attributes, modifications):
    """(code, attributes after the modifications) of the backend's trial on a copy."""
    state = {name: list(values) for name, values in attributes.items()}
    code = 0
    for operation, name, values in modifications:
        held = state.get(name, [])
        if operation == DELETE:
            code = 0
            if not held:
                code = 16
            elif values and name not in SECRET and not {v.lower() for v in values} <= {
                    v.lower() for v in held}:
                code = 16
            elif not values or name in SECRET:
                del state[name]
            else:
                gone = {v.lower() for v in values}
                state[name] = [v for v in held if v.lower() not in gone]
                if not state[name]:
                    del state[name]
            continue
        if operation == REPLACE:
            state.pop(name, None)
            held, code = [], 0
        if code == 0 and values:
            if name not in SECRET and {v.lower() for v in held} & {v.lower() for v in values}:
                code = 20
            else:
                state[name] = held + list(values)
    return code, state


def schema_check(entry_dn, attributes):
    classes = attributes.get("objectClass", [])
    structural = [c for c in classes if c not in AUXILIARY | {"top", "orv-slapdConfigEntry"}]
    if not classes or any(c not in CLASSES for c in classes):
        return 65
    for name, values in attributes.items():
        if len(values) > 1 and name not in MULTI_VALUED:
            return 19
    allowed = {"cn", "objectClass"}.union(*(CLASSES[c] for c in classes))
    if not set(attributes) <= allowed or len(structural) != 1:
        return 65
    needed = {"cn"}.union(*(MANDATORY.get(c, set()) for c in classes))
    if not needed <= set(attributes):
        return 65
    named = entry_dn.split(",")[0].split("=")[1]
    return 0 if named in [value.lower() for value in attributes["cn"]] else 64


# ---- authority

def supplier_may(caller, dn, modifications):
    only_suffixes = all(name == "orv-slapdSuffix" and operation == ADD
                        for operation, name, _ in modifications)
    own = caller.kind == SERVER_SUPPLIER or all(
        set(values or []) <= set(caller.suffixes) for _, _, values in modifications)
    return 0 if dn == DIRECTORY and only_suffixes and own else 50


def has_role(bits, dn, classes):
    if dn == MASTER_SERVER or "orv-slapdSupplier" in classes:
        needed = REPLICATION_OF_SERVER | SCHEMA | SERVER
        return bits & needed == needed
    return bool(bits & OWN_BITS.get(dn, SERVER))


def member_may(caller, dn, classes, modifications):
    types = [name for _, name, _ in modifications]
    if in_group(dn):
        return 0 if dn == caller.entry and types == ["orv-slapdAdminPW"] else 50
    if not caller.bits & ANY_ROLE or not has_role(caller.bits, dn, classes) or dn == POLICY:
        return 50
    forbidden = {"cn=kerberos," + TOP: {"orv-slapdKrbAdminDN"},
                 "cn=digest," + TOP: {"orv-slapdDigestAdminUser"},
                 TOP: {"orv-slapdAdminDN", "orv-slapdAdminPW", "orv-slapdAdminGroupEnabled"}}
    return 50 if forbidden.get(dn, set()) & set(types) else 0


def roles_after(dn, attributes, modifications):
    """What the rule on roles says to the primary administrator, and the list as it leaves it."""
    types = [name for _, name, _ in modifications]
    if not in_group(dn) or "orv-slapdAdminRole" not in types:
        return 0, modifications
    held = [value.lower() for value in attributes.get("orv-slapdAdminRole", [])]
    if not held:
        return 16, modifications
    less = 0
    for operation, name, values in modifications:
        if name != "orv-slapdAdminRole":
            continue
        if operation == DELETE and values and values[-1].lower() not in held:
            return 16, modifications
        less += {DELETE: 1, ADD: -1, REPLACE: 0}[operation] * len(values or [])
    if less != len(held):
        return 0, modifications
    first = [operation for operation, _, _ in modifications].index(DELETE)
    name = modifications[first][1]
    return 0, [*modifications[:first], (REPLACE, name, ["NoAdmin"]), *modifications[first + 1:]]


# ---- passwords

def password_rule(dn, attributes, modifications):
    """A new password needs somebody whose password it is: 32. That it is good is taken for granted."""
    for wanted in ("orv-slapdAdminPW", "orv-slapdMasterPW"):
        given = [m for m in modifications if m[1] == wanted]
        if not given:
            continue
        if given[0][0] == DELETE:
            return 0
        if dn == TOP or in_group(dn):
            return 0 if "orv-slapdAdminPW" in attributes else 32
        identities = {"orv-slapdReplication", "orv-slapdSupplier"}
        return 0 if identities & set(attributes["objectClass"]) else 32
    return 0


def written(attributes, modifications):
    """What the trial does not look at: whether a password that is deleted is the one that is there."""
    for number, (operation, name, values) in enumerate(modifications):
        if operation == DELETE and name in SECRET and values:
            _, state = changed(attributes, modifications[:number])
            if not set(values) <= set(state.get(name, [])):
                return 16
    return 0


def expected(caller, dn, attributes, modifications):
    """The result code. `attributes` of the entry as it is, None where there is none."""
    if caller.kind == STRANGER:
        return 50
    as_sent = sent_as_it_is(caller, dn)
    code = unspeakable(modifications)
    if not code and not as_sent:
        code = first_of(lambda: class_change(modifications), lambda: unfoldable(modifications),
                        lambda: takes_name_away(dn, modifications),
                        lambda: guarded(dn, modifications))
    if code:
        return code
    if not as_sent:
        modifications = folded(modifications)
    if attributes is None:
        return 32
    code, state = changed(attributes, modifications)
    code = code or schema_check(dn, state)
    begins_with_roles = modifications[0][1] == "orv-slapdAdminRole"
    if code == 65 and in_group(dn) and begins_with_roles:
        code = 0
    if code:
        return code
    if caller.kind in (SERVER_SUPPLIER, SUFFIX_SUPPLIER):
        return supplier_may(caller, dn, modifications)
    if caller.kind == MEMBER:
        return first_of(
            lambda: member_may(caller, dn, attributes["objectClass"], modifications),
            lambda: password_rule(dn, attributes, modifications),
            lambda: written(attributes, modifications))
    code, modifications = roles_after(dn, attributes, modifications)
    if code == 0 and in_group(dn) and begins_with_roles:
        code, state = changed(attributes, modifications)
        code = code or schema_check(dn, state)
    return code or first_of(lambda: password_rule(dn, attributes, modifications),
                            lambda: written(attributes, modifications))
