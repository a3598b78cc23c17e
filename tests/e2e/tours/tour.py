"""The tour of a server with python3-ldap: prints what expected.txt holds.

    tour.py start-tls|ldaps PORT TRUSTED-PEM OTHER-PEM PASSWORD-FILE
"""

import pathlib
import sys

import ldap
import ldap.controls
import ldap.dn
import ldap.filter
import ldap.schema

BASE = "cn=configuration"
PLACE = "cn=schemas," + BASE
GROUP = "cn=admingroup," + BASE
ODD_NAME = "Größe, \"klein\" + <groß> \\ 1; (2*3)=6"
ODD = "cn=%s,%s" % (ldap.dn.escape_dn_chars(ODD_NAME), PLACE)
TOURIST = "cn=tourist," + GROUP
FIRST_PASSWORD, SECOND_PASSWORD = "Vx7#kq9!Zp3$", "Größe-8?Wm4&Jt6"
SECONDS = 30

# How this library presents a result code, and the name that RFC 4511 gives it.
ERRORS = {
    4: (ldap.SIZELIMIT_EXCEEDED, "sizeLimitExceeded"),
    12: (ldap.UNAVAILABLE_CRITICAL_EXTENSION, "unavailableCriticalExtension"),
    16: (ldap.NO_SUCH_ATTRIBUTE, "noSuchAttribute"),
    17: (ldap.UNDEFINED_TYPE, "undefinedAttributeType"),
    19: (ldap.CONSTRAINT_VIOLATION, "constraintViolation"),
    20: (ldap.TYPE_OR_VALUE_EXISTS, "attributeOrValueExists"),
    21: (ldap.INVALID_SYNTAX, "invalidAttributeSyntax"),
    32: (ldap.NO_SUCH_OBJECT, "noSuchObject"),
    34: (ldap.INVALID_DN_SYNTAX, "invalidDNSyntax"),
    49: (ldap.INVALID_CREDENTIALS, "invalidCredentials"),
    50: (ldap.INSUFFICIENT_ACCESS, "insufficientAccessRights"),
    53: (ldap.UNWILLING_TO_PERFORM, "unwillingToPerform"),
    64: (ldap.NAMING_VIOLATION, "namingViolation"),
    65: (ldap.OBJECT_CLASS_VIOLATION, "objectClassViolation"),
    66: (ldap.NOT_ALLOWED_ON_NONLEAF, "notAllowedOnNonLeaf"),
    67: (ldap.NOT_ALLOWED_ON_RDN, "notAllowedOnRDN"),
    68: (ldap.ALREADY_EXISTS, "entryAlreadyExists"),
    69: (ldap.NO_OBJECT_CLASS_MODS, "objectClassModsProhibited"),
}


def heading(text):
    print("== " + text)


def presented(error):
    code = error.args[0].get("result")
    kind, name = ERRORS.get(code, (None, None))
    if type(error) is kind:
        return "%d %s" % (code, name)
    return "unexpectedly %r" % error


def show(label, action, *arguments, **named):
    """Prints what came of an action: what it returned, or the error."""
    try:
        outcome = action(*arguments, **named)
        print("%s: %s" % (label, "done" if outcome is None else outcome))
    except ldap.LDAPError as error:
        print("%s: %s" % (label, presented(error)))


def values(*texts):
    return [text.encode() for text in texts]


def listed(texts):
    return ", ".join(sorted(texts)) or "none"


class Tour:
    def __init__(self, transport, port, trusted, other, password_file):
        self.transport = transport
        self.port = port
        self.trusted, self.other = trusted, other
        self.password = pathlib.Path(password_file).read_text(encoding="utf-8")

    # ---- connections

    def connect(self, host="localhost", trust=None, check=ldap.OPT_X_TLS_DEMAND):
        scheme = "ldaps" if self.transport == "ldaps" else "ldap"
        client = ldap.initialize("%s://%s:%s" % (scheme, host, self.port))
        client.protocol_version = ldap.VERSION3
        for option, value in ((ldap.OPT_REFERRALS, 0), (ldap.OPT_TIMEOUT, SECONDS),
                              (ldap.OPT_NETWORK_TIMEOUT, SECONDS),
                              (ldap.OPT_X_TLS_CACERTFILE, trust or self.trusted),
                              (ldap.OPT_X_TLS_REQUIRE_CERT, check),
                              (ldap.OPT_X_TLS_NEWCTX, 0)):
            client.set_option(option, value)
        if self.transport == "start-tls":
            client.start_tls_s()
        client.simple_bind_s("", "")
        return client

    def connects(self, *arguments):
        try:
            self.connect(*arguments).unbind_s()
            return "accepted"
        except (ldap.CONNECT_ERROR, ldap.SERVER_DOWN):
            # The library does not say why; it was the certificate if all is well without a look at it.
            self.connect(*arguments, check=ldap.OPT_X_TLS_NEVER).unbind_s()
            return "refused"

    def certificates(self):
        heading("the server's certificate")
        show("trusted, under its name", self.connects)
        show("not trusted", self.connects, "localhost", self.other)
        show("trusted, under another name", self.connects, "127.0.0.2")

    def binds(self):
        heading("binds")
        self.client = self.connect()
        show("anonymous, reads the tree", self.read, BASE)
        show("wrong password", self.bind, "cn=root", "wrong")
        show("somebody unknown", self.bind, "cn=nobody", "wrong")
        show("a name without a password", self.bind, "cn=root", "")
        show("still anonymous", self.read, BASE)
        show("primary administrator", self.bind, "cn=root", self.password)

    def bind(self, who, password, client=None):
        (client or self.client).simple_bind_s(who, password)

    # ---- what the server says about itself

    def root_dse(self):
        heading("root DSE")
        entry = self.client.read_rootdse_s(attrlist=["*", "+"])
        print("versions: " + listed(v.decode() for v in entry["supportedLDAPVersion"]))
        print("naming contexts: " + listed(v.decode() for v in entry["namingContexts"]))
        offers = b"1.3.6.1.4.1.1466.20037" in entry.get("supportedExtension", [])
        print("offers StartTLS under TLS: " + ("yes" if offers else "no"))

    def schema(self):
        heading("schema")
        dn = self.client.search_subschemasubentry_s()
        print("stands in: " + dn)
        schema = ldap.schema.SubSchema(self.client.read_subschemasubentry_s(dn))
        for name in ("orv-slapdTop", "orv-slapdAdminGroupMember"):
            found = schema.get_obj(ldap.schema.ObjectClass, name)
            print("%s: must have %s; may have orv-slapdAdminPW: %s" % (
                name, listed(found.must), "yes" if "orv-slapdAdminPW" in found.may else "no"))
        for name in ("orv-slapdAdminDN", "orv-slapdAdminRole", "orv-slapdSizeLimit"):
            found = schema.get_obj(ldap.schema.AttributeType, name)
            print("%s: %s value, equality %s" % (
                name, "single" if found.single_value else "multi", found.equality))

    # ---- entries

    def adds(self):
        heading("add")
        show("a name full of escapes", self.add, ODD, objectClass=["top", "container"],
             cn=[ODD_NAME], description=["Maß für Maß", "eins"])
        show("a member", self.add_member, "tourist", FIRST_PASSWORD)
        show("the same again", self.add_member, "tourist", FIRST_PASSWORD)
        show("a member with a password that is too weak", self.add_member, "weak", "weak")
        show("an attribute that the class does not allow", self.add, "cn=x," + PLACE,
             objectClass=["top", "container"], cn=["x"], **{"orv-slapdPort": ["1"]})
        show("below an entry that is not there", self.add, "cn=x,cn=nowhere," + PLACE,
             objectClass=["top", "container"], cn=["x"])
        show("a password in the name", self.add, "cn=x+orv-slapdAdminPW=x," + PLACE,
             objectClass=["top", "container"], cn=["x"])
        show("an attribute that nobody knows", self.add, "cn=x," + PLACE,
             objectClass=["top", "container"], cn=["x"], unheardOf=["1"])

    def add(self, dn, **attributes):
        self.client.add_s(dn, [(name, values(*texts)) for name, texts in attributes.items()])

    def add_member(self, name, password):
        self.add("cn=%s,%s" % (name, GROUP), **{
            "objectClass": ["top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"],
            "cn": [name], "orv-slapdAdminDN": ["cn=" + name], "orv-slapdAdminPW": [password],
            "orv-slapdAdminRole": ["AuditAdmin"]})

    def read(self, dn, name="cn", client=None):
        (_, entry), = (client or self.client).search_s(dn, ldap.SCOPE_BASE, attrlist=[name])
        return listed(value.decode() for value in entry.get(name, []))

    def searches(self):
        heading("search")
        levels = (("base", ldap.SCOPE_BASE), ("one level", ldap.SCOPE_ONELEVEL),
                  ("subtree", ldap.SCOPE_SUBTREE))
        for name, scope in levels:
            show(name, self.names, GROUP, scope, "(objectClass=*)")
        for label, text in (
                ("value with everything escaped",
                 ldap.filter.filter_format("(cn=%s)", [ODD_NAME])),
                ("bytes in hexadecimal", r"(cn=gr\c3\b6\C3\9FE*)"),
                ("other letter case", "(cn=GRÖßE*\\282\\2a3\\29=6)"),
                ("middle of a value", "(description=*ß FÜR m*)"),
                ("and, or, not", "(&(objectClass=container)(|(cn=größe*)(cn=tourist))(!(cn=x)))"),
                ("star as a letter", r"(cn=\2a)"),
                ("password as a condition", "(orv-slapdAdminPW=V*)"),
                ("presence of a password", "(&(cn=tourist)(orv-slapdAdminPW=*))")):
            show(label, self.names, BASE, ldap.SCOPE_SUBTREE, text)
        show("nowhere", self.names, "cn=nowhere," + BASE, ldap.SCOPE_BASE, "(objectClass=*)")
        show("what is no name", self.names, "nonsense", ldap.SCOPE_BASE, "(objectClass=*)")
        show("at most one entry", self.limited)
        unknown = ldap.controls.RequestControl("1.3.6.1.4.1.4203.666.5.99", True, None)
        show("with a critical control that nobody knows", self.names, BASE, ldap.SCOPE_BASE,
             "(objectClass=*)", [unknown])

    def names(self, base, scope, text, controls=None):
        found = self.client.search_ext_s(base, scope, text, ["1.1"], serverctrls=controls)
        return listed(ldap.dn.str2dn(dn)[0][0][1] for dn, _ in found)

    def limited(self):
        self.client.search_ext_s(BASE, ldap.SCOPE_SUBTREE, sizelimit=1)

    def changes(self):
        heading("modify")
        replace, add, delete = ldap.MOD_REPLACE, ldap.MOD_ADD, ldap.MOD_DELETE
        show("add", self.change, ODD, (add, "description", values("zwei", "drei")))
        show("now", self.read, ODD, "description")
        show("delete", self.change, ODD, (delete, "description", values("EINS")))
        show("now", self.read, ODD, "description")
        show("several at once", self.change, ODD, (delete, "description", values("zwei")),
             (add, "description", values("fünf")), (add, "cn", values("second name")))
        show("now", self.read, ODD, "description")
        show("and", self.read, ODD, "cn")
        show("replace", self.change, ODD, (replace, "description", values("vier")))
        show("now", self.read, ODD, "description")
        show("delete all", self.change, ODD, (delete, "description", None))
        show("now", self.read, ODD, "description")
        show("delete what is not there", self.change, ODD, (delete, "description", None))
        show("add what is there", self.change, ODD, (add, "cn", values("Second Name")))
        show("take the name away", self.change, ODD, (delete, "cn", values(ODD_NAME)))
        show("another class", self.change, ODD, (replace, "objectClass", values("top")))
        show("a number that is none", self.change, BASE,
             (replace, "orv-slapdSizeLimit", values("many")))
        show("a truth that is none", self.change, BASE,
             (replace, "orv-slapdAdminGroupEnabled", values("perhaps")))
        show("an entry that is not there", self.change, "cn=x," + PLACE,
             (replace, "description", values("x")))
        show("rename", self.client.rename_s, ODD, "cn=other")
        show("compare", self.client.compare_s, ODD, "cn", b"second name")

    def change(self, dn, *modifications, client=None):
        (client or self.client).modify_s(dn, list(modifications))

    def delete(self, dn, client=None):
        (client or self.client).delete_s(dn)

    # ---- a member

    def member(self):
        heading("member of the group")
        member = self.connect()
        show("bind", self.bind, "cn=tourist", FIRST_PASSWORD, member)
        show("reads the audit log's entry", self.read, "cn=audit,cn=log management," + BASE, "cn",
             member)
        show("its own password", self.has_password, member, TOURIST)
        show("that of the primary administrator", self.has_password, member, BASE)
        show("deletes a member", self.delete, TOURIST, member)
        show("changes its password", self.change, TOURIST,
             (ldap.MOD_REPLACE, "orv-slapdAdminPW", values(SECOND_PASSWORD)), client=member)
        other = self.connect()
        show("old password", self.bind, "cn=tourist", FIRST_PASSWORD, other)
        show("new password", self.bind, "cn=tourist", SECOND_PASSWORD, other)
        show("is deleted", self.delete, TOURIST)
        show("its connection", self.told_of_the_end, other)
        show("works", self.works, other)
        show("binds again", self.bind, "cn=tourist", SECOND_PASSWORD, self.connect())

    @staticmethod
    def has_password(client, dn):
        (_, entry), = client.search_s(dn, ldap.SCOPE_BASE)
        return "shown" if "orv-slapdAdminPW" in entry else "hidden"

    @staticmethod
    def told_of_the_end(client):
        """The notice of disconnection is an answer to nothing, with a code of its own."""
        try:
            client.result4(ldap.RES_UNSOLICITED, timeout=SECONDS)
        except ldap.STRONG_AUTH_REQUIRED as notice:
            return "told of its end" if notice.args[0]["msgid"] == 0 else repr(notice)
        return "not told of its end"

    @staticmethod
    def works(client):
        try:
            client.search_s(BASE, ldap.SCOPE_BASE)
            return "yes"
        except ldap.SERVER_DOWN:
            return "no"

    # ---- the end

    def end(self):
        heading("delete and unbind")
        show("an entry with others below it", self.delete, PLACE)
        show("the one full of escapes", self.delete, ODD)
        show("again", self.delete, ODD)
        show("what is left", self.names, BASE, ldap.SCOPE_SUBTREE, "(|(cn=größe*)(cn=tourist))")
        show("unbind", self.client.unbind_s)

    def run(self):
        self.certificates()
        self.binds()
        self.root_dse()
        self.schema()
        self.adds()
        self.searches()
        self.changes()
        self.member()
        self.end()


if __name__ == "__main__":
    Tour(*sys.argv[1:]).run()
