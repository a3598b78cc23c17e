"""Random sequences of modifications against a model in memory: after each of them the file and a
search agree with the model, and a refused one has changed no byte.

ORV_MODEL_SECONDS: how long it goes on (default 8). ORV_MODEL_SEED: where it starts; the seed is
printed, and one run with it is repeated exactly as far as its time goes.
"""

import os
import random
import time

import ldap

from orv_e2e import clients, programs
from orv_e2e.changes import modify
from orv_e2e.config_file import MEMBER_CLASSES

SECONDS = float(os.environ.get("ORV_MODEL_SECONDS", "8"))
SEED = int(os.environ.get("ORV_MODEL_SEED", str(random.SystemRandom().randrange(10 ** 9))))
LEAST = 40  # lists that must have been taken for the run to mean anything

ADD, DELETE, REPLACE = ldap.MOD_ADD, ldap.MOD_DELETE, ldap.MOD_REPLACE
ROLE, SUBTREE, DIGEST = "orv-slapdAdminRole", "orv-slapdPtaSubtree", "orv-slapdDigestAdminUser"
CONFIG = "orv-slapdConfigEntry"

# Values by type. Spellings of one value stand together; what the server never takes is in REFUSED.
POOLS = {
    "description": [["one", "One", "ONE "], ["two words", "Two  Words"], ["stra\u00dfe", "STRASSE"],
                    ["\u65e5\u672c", ], ["5"]],
    "orv-slapdSuffix": [["o=one", "O = One"], ["ou=a,o=two", "ou=a, o=two", "2.5.4.11=A,o=Two"],
                        ["o=three\\, four", "o=Three\\2c Four"]],
    ROLE: [["AuditAdmin", "auditadmin"], ["SchemaAdmin"], ["PasswordAdmin"], ["Wizard"]],
    DIGEST: [["bert"], ["BERT"], ["taken"]],
    "orv-slapdMaxPendingOperations": [["64"], ["128"], ["0"], ["many"]],
    "orv-slapdLogLevel": [["info", "INFO"], ["error"], ["loud"]],
    "orv-slapdPtaURL": [["ldap://a.example.com"], ["ldaps://b.example.com"], ["no url"]],
    SUBTREE: [["o=first", "O=First"], ["ou=x,o=second"], ["o=second"], ["cn=schema"],
              ["ou=y,o=elsewhere"]],
    "orv-slapdMasterSuffix": [["o=fed", "O = FED"], ["ou=b,o=fed"]],
}
# What the file cannot hold is refused too: 21.
UNFIT = {value for pool in POOLS.values() for spellings in pool for value in spellings
         if not programs.fits_code_page(value)}
REFUSED = {ROLE: {"Wizard": 80}, "orv-slapdMaxPendingOperations": {"0": 19, "many": {19, 21}},
           "orv-slapdLogLevel": {"loud": 19}, "orv-slapdPtaURL": {"no url": 21}}
SINGLE = {DIGEST, "orv-slapdMaxPendingOperations", "orv-slapdLogLevel", "orv-slapdPtaURL"}

ENTRIES = {
    "cn=configuration": (["description", "orv-slapdMaxPendingOperations"], set()),
    "cn=shelf,cn=schemas,cn=configuration": (["description"], set()),
    "cn=directory,cn=rdbm backends,cn=orv directory,cn=schemas,cn=configuration":
        (["orv-slapdSuffix", "description"], set()),
    "cn=bert,cn=admingroup,cn=configuration": ([ROLE, DIGEST, "description"], {ROLE}),
    "cn=access,cn=log management,cn=configuration": (["orv-slapdLogLevel"], set()),
    "cn=partner,cn=passthrough authentication,cn=configuration":
        (["orv-slapdPtaURL", SUBTREE, "description"], {"orv-slapdPtaURL", SUBTREE}),
    "cn=feeder,cn=replication,cn=configuration": (["orv-slapdMasterSuffix", "description"], set()),
}


def key_of(name, value):
    """The same for all spellings of a value."""
    for number, spellings in enumerate(POOLS[name]):
        if value in spellings:
            return number
    return value  # the file's own


def keys_of(name, values):
    return [key_of(name, value) for value in values]


# ---- the model

class Fold:
    """What the server makes of a list for one type, docs/guards.md; `reasons` when it does not."""

    def __init__(self, name):
        self.name = name
        self.whole = None      # the values, once a replace or a delete of all has said which
        self.only_deleted = False
        self.added, self.deleted = [], []
        self.named = []        # all values of the list
        self.reasons = set()

    def take(self, operation, values):
        self.named += values
        keys = keys_of(self.name, values)
        if len(set(keys)) < len(keys):
            self.reasons.add(20)
        if operation == REPLACE or not values:
            self._take_whole(operation, values)
        elif self.whole is None:
            self._take_parts(operation, values)
        else:
            self.only_deleted = False
            self._change_whole(operation, values)

    def _take_whole(self, operation, values):
        if self.added or self.deleted:
            self.reasons.add(53)
        if operation == DELETE and self.whole == []:
            self.reasons.add(16)
        self.only_deleted = operation == DELETE and self.whole is None
        self.whole = list(values)

    def _take_parts(self, operation, values):
        same, other = (self.added, self.deleted) if operation == ADD else (self.deleted, self.added)
        for value in values:
            if key_of(self.name, value) in keys_of(self.name, other):
                self.reasons.add(53)
            if key_of(self.name, value) in keys_of(self.name, same):
                self.reasons.add(20)
            same.append(value)

    def _change_whole(self, operation, values):
        for value in values:
            held = keys_of(self.name, self.whole)
            there = key_of(self.name, value) in held
            if there == (operation == ADD):
                self.reasons.add(20 if there else 16)
            elif operation == ADD:
                self.whole.append(value)
            else:
                del self.whole[held.index(key_of(self.name, value))]

    def result(self, held):
        """(reasons, values) for an entry that holds `held`."""
        if self.whole is not None:
            return {16} if self.only_deleted and not held else set(), list(self.whole)
        keys = keys_of(self.name, held)
        reasons = {20 for value in self.added if key_of(self.name, value) in keys}
        reasons |= {16 for value in self.deleted if key_of(self.name, value) not in keys}
        gone = keys_of(self.name, self.deleted)
        return reasons, [value for value in held if key_of(self.name, value) not in gone
                         ] + self.added

    def brings(self):
        return self.whole or self.added


def nested(subtrees):
    parts = [value.lower().replace(" ", "") for value in subtrees]
    return any(a != b and a.endswith("," + b) for a in parts for b in parts) or "cn=schema" in parts


def rules(dn, folds, before, after):
    """The codes with which some rule refuses the change of an entry."""
    reasons = set()
    for name, fold in folds.items():
        if UNFIT & set(fold.named):
            reasons.add(21)
        # Of roles the rule knows those that are deleted, too.
        for value in fold.brings() + (fold.deleted if name == ROLE else []):
            found = REFUSED.get(name, {}).get(value, set())
            reasons |= found if isinstance(found, set) else {found}
        if name in SINGLE and len(after[name]) > 1:
            reasons.add(19)
        if name in ENTRIES[dn][1] and not after[name]:
            reasons.add(65)
    if nested(after.get(SUBTREE, [])):
        reasons.add(19)
    taken = {"taken", *before.get(DIGEST, [])}
    if DIGEST in folds and set(folds[DIGEST].brings()[:1]) & taken:
        reasons.add(68)
    return reasons


def deletes_roles_too_early(folds):
    """Roles by value, and in front of what else is taken away: refused with 53."""
    types = list(folds)
    fold = folds.get(ROLE)
    if fold is None or fold.whole is not None or not fold.deleted:
        return False
    behind = [folds[name] for name in types[types.index(ROLE) + 1:]]
    return any(other.whole is not None or other.deleted for other in behind)


def stores_no_admin(folds, before, after):
    """The last roles taken away one by one, in front of everything else."""
    fold = folds.get(ROLE)
    return (fold is not None and next(iter(folds)) == ROLE and fold.whole is None
            and not fold.added and before[ROLE] and not after[ROLE])


def applied(dn, entry, modifications):
    """(reasons to refuse, entry afterwards)."""
    folds = {}
    for operation, name, values in modifications:
        folds.setdefault(name, Fold(name)).take(operation, values or [])
    reasons = set().union(*(fold.reasons for fold in folds.values()))
    if deletes_roles_too_early(folds):
        reasons.add(53)
    after = dict(entry)
    for name, fold in folds.items():
        found, after[name] = fold.result(entry[name])
        reasons |= found
    if reasons & {16, 20}:
        # Behind a failure adds are not tried, and a delete that fails may be forgotten: the trial
        # then finds too few values, or too many.
        reasons |= {19, 65}
    if stores_no_admin(folds, entry, after):
        after[ROLE] = ["NoAdmin"]
    return reasons | rules(dn, folds, entry, after), after


# ---- the sequences

def random_values(source, name, operation, held):
    count = source.choice([1, 1, 1, 2, 3]) if operation != DELETE else source.choice([0, 1, 1, 2])
    if operation == REPLACE and source.random() < 0.15:
        count = 0
    groups = source.sample(POOLS[name], min(count, len(POOLS[name])))
    values = [source.choice(spellings) for spellings in groups]
    # Deletes of what is there, or little would ever go.
    if operation == DELETE and count and held and source.random() < 0.7:
        values = source.sample(held, min(count, len(held)))
    if values and source.random() < 0.05:
        values.append(values[0])
    return values


def random_list(source, dn, entry):
    names = source.sample(ENTRIES[dn][0], min(source.choice([1, 1, 2, 3]), len(ENTRIES[dn][0])))
    modifications = []
    for _ in range(source.randint(1, 4)):
        name = source.choice(names)
        operation = source.choice([ADD, ADD, DELETE, DELETE, REPLACE])
        values = random_values(source, name, operation, entry[name])
        if operation == ADD and not values:
            continue
        modifications.append((operation, name, values or None))
    return modifications or [(REPLACE, names[0], None)]


def prepared(instance):
    # Most lists fail, which a single client may not have happen without end.
    instance.config.set("cn=configuration", "orv-slapdMaxFailedChangeSize", "268435456")
    instance.config.add("cn=shelf,cn=schemas,cn=configuration",
                        [("objectClass", ["top", "container"]), ("cn", "shelf")])
    instance.config.add("cn=bert,cn=admingroup,cn=configuration", [
        ("objectClass", MEMBER_CLASSES), ("cn", "bert"), ("orv-slapdAdminDN", "cn=bert"),
        (ROLE, ["AuditAdmin", "SchemaAdmin"])])
    instance.config.add("cn=ernie,cn=admingroup,cn=configuration", [
        ("objectClass", MEMBER_CLASSES), ("cn", "ernie"), ("orv-slapdAdminDN", "cn=ernie"),
        (ROLE, "NoAdmin"), (DIGEST, "taken")])
    instance.config.add("cn=partner,cn=passthrough authentication,cn=configuration", [
        ("objectClass", ["top", CONFIG, "orv-slapdPta"]), ("cn", "partner"),
        ("orv-slapdPtaURL", "ldap://a.example.com"), (SUBTREE, "o=first")])
    instance.config.add("cn=other,cn=passthrough authentication,cn=configuration", [
        ("objectClass", ["top", CONFIG, "orv-slapdPta"]), ("cn", "other"),
        ("orv-slapdPtaURL", "ldap://c.example.com"), (SUBTREE, "o=others")])
    instance.config.add("cn=feeder,cn=replication,cn=configuration", [
        ("objectClass", ["top", CONFIG, "orv-slapdSupplier"]), ("cn", "feeder"),
        ("orv-slapdMasterDN", "cn=feeder")])
    return instance.start()


def modelled(entries, code_page="utf-8"):
    """Of all entries what the model knows, values in their order."""
    return {dn: {name: [value.decode(code_page) for value in entries[dn].get(name, [])]
                 for name in ENTRIES[dn][0]} for dn in ENTRIES}


def modelled_file(instance):
    """All of the file, and the part of it that the model knows."""
    entries = clients.parse_ldif(instance.config.read())
    return entries, modelled(entries, programs.code_page())


def in_any_order(model):
    return {dn: {name: sorted(values) for name, values in entry.items()}
            for dn, entry in model.items()}


def unmodelled(entries):
    """What no modification of these tests has anything to do with."""
    return {dn: {name: values for name, values in attributes.items()
                 if name not in ENTRIES.get(dn, ([],))[0]} for dn, attributes in entries.items()}


def test_random_sequences_leave_file_and_search_as_the_model_says(instance):
    print("ORV_MODEL_SEED=%d" % SEED)
    source = random.Random(SEED)
    root = clients.bind(prepared(instance))
    at_first, model = modelled_file(instance)
    end = time.monotonic() + SECONDS
    taken, refused = 0, 0
    while time.monotonic() < end or taken < LEAST:
        dn = source.choice(list(ENTRIES))
        modifications = random_list(source, dn, model[dn])
        reasons, after = applied(dn, model[dn], modifications)
        before = instance.config.read()
        code = modify(root, dn, *modifications)
        told = "seed %d: %s %s in %s" % (SEED, dn, modifications, model[dn])
        if code != 0:
            refused += 1
            assert code in reasons, "%d, not one of %s; %s" % (code, reasons, told)
            assert instance.config.read() == before, told
            continue
        taken += 1
        assert not reasons, "taken, not refused with one of %s; %s" % (reasons, told)
        model[dn] = after
        entries, stored = modelled_file(instance)
        assert in_any_order(stored) == in_any_order(model), told
        assert unmodelled(entries) == unmodelled(at_first), told
        shown = modelled({**dict.fromkeys(ENTRIES, {}), dn: clients.read(root, dn)})[dn]
        assert shown == stored[dn], told
    print("%d lists taken, %d refused" % (taken, refused))
    assert modelled(clients.search(root)) == modelled_file(instance)[1]
    root.unbind_s()
