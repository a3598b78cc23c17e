"""Who am I, Cancel, and the controls assertion, pre-read, post-read and paged results, by clients."""

import re
import subprocess

import ldap
import pytest
from ldap.controls import RequestControl
from ldap.controls.libldap import AssertionControl, SimplePagedResultsControl
from ldap.controls.readentry import PostReadControl, PreReadControl
from ldap.extop import ExtendedRequest

from orv_e2e import clients, wire
from orv_e2e.changes import GROUP, PASSWORD, PLACE, add, container, member, supplier
from orv_e2e.clients import code_of
from orv_e2e.config_file import record
from orv_e2e.persistent import Listener
from orv_e2e.programs import DEADLINE
from test_audit_log import Records, log_of

ASSERTION, PRE_READ, POST_READ = "1.3.6.1.1.12", "1.3.6.1.1.13.1", "1.3.6.1.1.13.2"
PAGED, CANCEL, WHO_AM_I = "1.2.840.113556.1.4.319", "1.3.6.1.1.8", "1.3.6.1.4.1.4203.1.11.3"
SORT = "1.2.840.113556.1.4.473"


def bind_member(server, root, name, roles=("ServerConfigGroupMember",)):
    assert add(root, *member(name, roles=roles)) == 0
    return clients.bind(server, "cn=" + name, PASSWORD)


def with_place(root, name="shelf", **more):
    """A container where nothing is protected."""
    dn, attributes = container(name, **more)
    assert add(root, dn, attributes) == 0
    return dn


def describe(value):
    return [(ldap.MOD_REPLACE, "description", [value])]


# ---- what is offered

def test_the_root_dse_offers_exactly_what_is_there(server):
    dse = clients.read(clients.connect(server), "", ["+"])
    assert {oid.decode() for oid in dse["supportedControl"]} == {
        "2.16.840.1.113730.3.4.2", "2.16.840.1.113730.3.4.3", "2.16.840.1.113730.3.4.7",
        ASSERTION, PRE_READ, POST_READ, PAGED}
    assert {oid.decode() for oid in dse["supportedExtension"]} == {
        CANCEL, WHO_AM_I, "1.3.6.1.4.1.1466.20037"}
    assert dse["supportedFeatures"] == [b"1.3.6.1.4.1.4203.1.5.1"]


def test_persistent_searches_that_are_switched_off_are_not_offered(instance):
    instance.config.set("CN=CONFIGURATION", "orv-slapdMaxPersistentSearches", "0")
    instance.start()
    offered = clients.read(clients.connect(instance), "", ["supportedControl"])["supportedControl"]
    assert not {b"2.16.840.1.113730.3.4.3", b"2.16.840.1.113730.3.4.7"} & set(offered)
    assert PAGED.encode() in offered


def test_pages_that_are_switched_off_are_not_offered_and_not_served(instance):
    instance.config.set("CN=CONFIGURATION", "orv-slapdMaxPagedSearches", "0")
    instance.start()
    root = clients.bind(instance)
    assert PAGED.encode() not in clients.read(root, "", ["supportedControl"])["supportedControl"]

    def found(critical):
        control = SimplePagedResultsControl(critical, size=1, cookie="")
        return root.search_ext_s(clients.BASE, ldap.SCOPE_SUBTREE, serverctrls=[control])

    assert len(found(False)) > 1
    assert code_of(found, True) == 12


@pytest.mark.parametrize("oid", [SORT, "1.2.3.4"])
def test_controls_that_are_not_offered_are_refused_only_when_critical(root, oid):
    def search(critical):
        root.search_ext_s(clients.BASE, ldap.SCOPE_BASE, serverctrls=[RequestControl(oid, critical)])
    assert code_of(search, True) == 12
    assert code_of(search, False) == 0


@pytest.mark.parametrize("oid", [PRE_READ, POST_READ])
def test_controls_of_other_operations_are_refused_only_when_critical(root, oid):
    def search(critical):
        root.search_ext_s(clients.BASE, ldap.SCOPE_BASE,
                          serverctrls=[RequestControl(oid, critical, b"\x30\x00")])
    assert code_of(search, True) == 12
    assert code_of(search, False) == 0


# ---- Who am I

def test_who_am_i_tells_the_name_that_was_bound_with(server, root):
    assert root.whoami_s().lower() == "dn:cn=root"
    assert bind_member(server, root, "alice").whoami_s() == "dn:cn=alice"


def test_the_anonymous_are_nobody(server):
    assert clients.connect(server).whoami_s() == ""


def test_ldapwhoami_and_ldapexop_tell_it(server):
    for program, arguments in (("ldapwhoami", []), ("ldapexop", ["whoami"])):
        asked = clients.command(program, server, *arguments)
        assert asked.returncode == 0, asked.stderr
        assert b"dn:cn=root" in asked.stdout
    assert clients.command("ldapwhoami", server, who=None).stdout.strip() == b"anonymous"


def test_who_am_i_after_sasl_is_the_administrator(server):
    client = ldap.initialize(server.local_url)
    client.sasl_external_bind_s()
    assert client.whoami_s() == "dn:cn=root"
    client.unbind_s()


def test_who_am_i_takes_no_value(root):
    assert code_of(root.extop_s, ExtendedRequest(WHO_AM_I, b"x")) == 2
    assert code_of(root.extop_s, ExtendedRequest(WHO_AM_I, b"")) == 2


# ---- Cancel

def cancel(message_id):
    return ExtendedRequest(CANCEL, wire.tlv(0x30, wire.number(message_id)))


def test_a_persistent_search_can_be_canceled(server):
    client = clients.bind(server)
    listener = Listener(client).established()
    client.extop_s(cancel(listener.message_id))
    with pytest.raises(ldap.LDAPError) as ended:
        client.result(listener.message_id, timeout=DEADLINE)
    assert ended.value.args[0]["result"] == 118
    assert code_of(client.extop_s, cancel(listener.message_id)) == 119


def test_what_is_not_outstanding_cannot_be_canceled(root):
    assert code_of(root.extop_s, cancel(4711)) == 119
    assert code_of(root.extop_s, ExtendedRequest(CANCEL, b"")) == 2
    assert code_of(root.extop_s, ExtendedRequest(CANCEL, None)) == 2


def test_ldapexop_is_told_that_there_is_nothing_to_cancel(server):
    asked = clients.command("ldapexop", server, "cancel", "77")
    assert b"(119)" in asked.stderr + asked.stdout


def test_a_long_search_is_canceled_while_it_runs(instance):
    entries = [record("cn=e%d,%s" % (i, PLACE), [
        ("objectClass", ["top", "container"]), ("cn", "e%d" % i), ("description", "x" * 40)])
        for i in range(20000)]
    instance.config.append(b"\n".join(entries))
    instance.start()
    slow = wire.any_of(*[wire.equal("description", "nothing%d" % i) for i in range(2000)])
    with wire.bound(instance) as client:
        client.send(wire.search_request(2, scope=2, search_filter=slow))
        client.send(wire.message(3, wire.tlv(0x77, wire.octets(CANCEL, 0x80) + wire.octets(
            wire.tlv(0x30, wire.number(2)), 0x81))))
        first, second = client.answer(), client.answer()
        assert (first.message_id, first.tag, first.code) == (2, wire.SEARCH_DONE, 118)
        assert (second.message_id, second.tag, second.code) == (3, wire.EXTENDED_RESPONSE, 0)
        assert client.search(4) == (0, 1)


# ---- assertion

def test_a_change_is_made_only_while_its_assertion_holds(root):
    dn = with_place(root, description=["old"])
    good, bad = "(description=old)", "(description=something else)"
    assert code_of(root.modify_ext_s, dn, describe(b"new"), [AssertionControl(True, bad)]) == 122
    assert clients.read(root, dn)["description"] == [b"old"]
    root.modify_ext_s(dn, describe(b"new"), [AssertionControl(True, good)])
    assert clients.read(root, dn)["description"] == [b"new"]
    assert code_of(root.delete_ext_s, dn, [AssertionControl(False, good)]) == 122
    root.delete_ext_s(dn, [AssertionControl(True, "(description=new)")])


def test_two_clients_that_compare_and_set_never_both_win(server, root):
    dn = with_place(root, description=["0"])
    both = [clients.bind(server) for _ in range(2)]
    for number in range(20):
        asserted = [AssertionControl(True, "(description=%d)" % number)]
        asked = [client.modify_ext(dn, describe(b"%d" % (number + 1)), asserted) for client in both]
        codes = sorted(code_of(client.result3, message, timeout=DEADLINE)
                       for client, message in zip(both, asked))
        assert codes == [0, 122]


def test_an_assertion_on_an_added_entry_is_about_that_entry(root):
    dn, attributes = container("shelf", description=["x"])
    encoded = [(name, [value.encode() for value in values]) for name, values in attributes.items()]
    for filter_text, expected in (("(description=y)", 122), ("(orv-slapdAdminPW=*)", 122),
                                  ("(&(cn=shelf)(description=X))", 0)):
        asserted = [AssertionControl(True, filter_text)]
        assert code_of(root.add_ext_s, dn, encoded, asserted) == expected


def test_an_assertion_on_a_search_is_about_its_base(root):
    def found(filter_text):
        return root.search_ext_s(GROUP, ldap.SCOPE_SUBTREE,
                                 serverctrls=[AssertionControl(True, filter_text)])
    assert found("(cn=admingroup)")
    assert code_of(found, "(cn=alice)") == 122
    assert code_of(root.search_ext_s, "cn=nowhere," + PLACE, ldap.SCOPE_BASE,
                   serverctrls=[AssertionControl(True, "(cn=*)")]) == 32


@pytest.mark.parametrize("guess", [PASSWORD, "wrong"])
def test_an_assertion_is_no_oracle_for_a_password(server, root, guess):
    """Neither the administrator's nor another member's, and not even the own one."""
    bob = bind_member(server, root, "bob")
    bind_member(server, root, "alice")
    targets = [(root, "cn=alice," + GROUP), (bob, "cn=alice," + GROUP), (bob, "cn=bob," + GROUP),
               (bob, clients.BASE)]
    for filter_text in ("(orv-slapdAdminPW=%s)", "(!(orv-slapdAdminPW=%s))",
                        "(orv-slapdAdminPW=%s*)", "(orv-slapdAdminPW>=%s)",
                        "(2.25.83817390626969804497818767862655265745.1.2:caseExactMatch:=%s)"):
        for client, dn in targets:
            asserted = [AssertionControl(True, filter_text % guess)]
            assert code_of(client.search_ext_s, dn, ldap.SCOPE_BASE, serverctrls=asserted) == 122


@pytest.mark.parametrize("guess", [PASSWORD, "wrong"])
def test_a_change_is_no_oracle_for_a_password_by_its_assertion(server, root, guess):
    bob = bind_member(server, root, "bob")
    alice = "cn=alice," + GROUP
    assert add(root, *member("alice")) == 0
    before = server.config.read()
    for pattern in ("(orv-slapdAdminPW=%s)", "(!(orv-slapdAdminPW=%s))", "(orv-slapdAdminPW<=%s)",
                    "(|(orv-slapdAdminPW=%s)(!(orv-slapdAdminPW=%s)))", "(orv-slapdAdminPW~=%s)"):
        asserted = [AssertionControl(True, pattern.replace("%s", guess))]
        for client in (root, bob):
            for dn in (alice, "cn=bob," + GROUP, clients.BASE):
                codes = {code_of(client.modify_ext_s, dn, describe(b"guessed"), asserted),
                         code_of(client.delete_ext_s, dn, asserted),
                         code_of(client.modify_ext_s, dn, [
                             (ldap.MOD_REPLACE, "orv-slapdAdminPW", [b"Nq5%tr8?Yw2&"])], asserted)}
                assert codes == {122}, (pattern, dn)
    assert server.config.read() == before


@pytest.mark.parametrize("guess", [PASSWORD, "wrong"])
def test_the_number_of_pages_is_no_oracle_for_a_password(server, root, guess):
    bob = bind_member(server, root, "bob")
    for pattern in ("(orv-slapdAdminPW=%s)", "(!(orv-slapdAdminPW=%s))", "(orv-slapdAdminPW=%s*)",
                    "(&(objectClass=*)(orv-slapdAdminPW=%s))"):
        for client in (root, bob):
            pages = Pages(client, filter_text=pattern % guess)
            assert pages.next(0) == [] and pages.total == 0


def test_an_assertion_tells_a_member_nothing_of_the_administrator(server, root):
    bob = bind_member(server, root, "bob")
    for filter_text in ("(orv-slapdAdminDN=cn=root)", "(!(orv-slapdAdminDN=cn=root))"):
        asserted = [AssertionControl(True, filter_text)]
        assert code_of(bob.search_ext_s, clients.BASE, ldap.SCOPE_BASE,
                       serverctrls=asserted) == 122
        assert code_of(bob.modify_ext_s, clients.BASE,
                       [(ldap.MOD_REPLACE, "orv-slapdSizeLimit", [b"7"])], asserted) == 122
    assert clients.read(root, clients.BASE)["orv-slapdSizeLimit"] != [b"7"]


def test_a_failed_assertion_is_in_the_audit_log_like_any_attempt(server, root):
    dn = with_place(root)
    assert code_of(root.delete_ext_s, dn, [AssertionControl(True, "(cn=other)")]) == 122
    log = Records(log_of(server))
    assert log.facts[-1]["operation"] == "delete"
    assert log.facts[-1]["result"] == "122"


# ---- pre-read and post-read

def control_of(controls, kind):
    return next((each for each in controls if each.controlType == kind.controlType), None)


def change(client, operation, *arguments, controls):
    message = operation(*arguments, serverctrls=controls)
    return client.result3(message, timeout=DEADLINE)[3]


def test_a_change_shows_the_entry_before_and_after_it(root):
    dn = with_place(root, description=["old"])
    answered = change(root, root.modify_ext, dn, describe(b"new"), controls=[
        PreReadControl(True, ["description"]), PostReadControl(True, ["*"])])
    before, after = control_of(answered, PreReadControl), control_of(answered, PostReadControl)
    assert clients.dn_key(before.dn) == clients.dn_key(dn)
    assert before.entry == {"description": [b"old"]}
    assert after.entry["description"] == [b"new"]
    assert set(after.entry) == {"objectClass", "cn", "description"}


def test_a_deleted_entry_and_an_added_one_are_shown(root):
    dn, attributes = container("shelf", description=["x"])
    encoded = [(name, [value.encode() for value in values]) for name, values in attributes.items()]
    answered = change(root, root.add_ext, dn, encoded,
                      controls=[PostReadControl(True, ["description"])])
    assert control_of(answered, PostReadControl).entry == {"description": [b"x"]}
    answered = change(root, root.delete_ext, dn, controls=[PreReadControl(True, ["cn"])])
    assert control_of(answered, PreReadControl).entry == {"cn": [b"shelf"]}


@pytest.mark.parametrize("asked,shown", [
    ([], {"objectClass", "cn", "description"}), (["*"], {"objectClass", "cn", "description"}),
    (["+"], set()), (["1.1"], set()), (["2.5.4.13"], {"description"}),
    (["DESCRIPTION", "noSuchType"], {"description"}), (["description;lang-de"], set()),
    (["1.1", "cn"], {"cn"})])
def test_attributes_are_chosen_as_in_a_search(root, asked, shown):
    dn = with_place(root, description=["x"])
    value = wire.tlv(0x30, b"".join(wire.octets(name) for name in asked))
    control = PreReadControl(True, ["cn"])
    control.encodeControlValue = lambda: value
    answered = change(root, root.modify_ext, dn, describe(b"y"), controls=[control])
    assert set(control_of(answered, PreReadControl).entry) == shown


def test_a_change_that_fails_shows_nothing(root):
    dn = with_place(root)
    for request in ([(ldap.MOD_DELETE, "description", [b"no"])],
                    [(ldap.MOD_ADD, "cn", [b"shelf"])]):
        message = root.modify_ext(dn, request, serverctrls=[
            PreReadControl(True, ["*"]), PostReadControl(True, ["*"])])
        with pytest.raises(ldap.LDAPError) as failed:
            root.result3(message, timeout=DEADLINE)
        assert not failed.value.args[0].get("ctrls")


def test_members_never_see_hidden_attributes_around_a_change(server, root):
    bob = bind_member(server, root, "bob")
    answered = change(bob, bob.modify_ext, clients.BASE,
                      [(ldap.MOD_REPLACE, "orv-slapdSizeLimit", [b"777"])], controls=[
                          PreReadControl(True, ["*", "+", "orv-slapdAdminPW"]),
                          PostReadControl(True, ["*", "orv-slapdAdminDN"])])
    for kind in (PreReadControl, PostReadControl):
        shown = {name.lower() for name in control_of(answered, kind).entry}
        assert "orv-slapdsizelimit" in shown
        assert not shown & {"orv-slapdadminpw", "orv-slapdadmindn", "orv-slapdadmingroupenabled"}


def test_whoever_changes_the_own_password_is_shown_nothing_of_it(server, root):
    bob = bind_member(server, root, "bob")
    new = b"Nq5%tr8?Yw2&"
    answered = change(bob, bob.modify_ext, "cn=bob," + GROUP,
                      [(ldap.MOD_REPLACE, "orv-slapdAdminPW", [new])],
                      controls=[PostReadControl(True, ["*", "orv-slapdAdminPW"])])
    assert control_of(answered, PostReadControl).entry == {}
    assert clients.bind_code(server, "cn=bob", new.decode()) == 0


def test_suppliers_may_read_nothing_around_a_change(server, root):
    assert add(root, *supplier("mirror")) == 0
    mirror = clients.bind(server, "cn=mirror supplier", PASSWORD)
    dn, attributes = container("suffix", "cn=directory,cn=rdbm backends,cn=orv directory," + PLACE)
    encoded = [(name, [value.encode() for value in values]) for name, values in attributes.items()]
    for controls, expected in (
            ([PostReadControl(True, ["*"])], 12),
            ([PreReadControl(False, ["*"]), AssertionControl(False, "(cn=*)")], None)):
        code = code_of(mirror.add_ext_s, dn, encoded, controls)
        assert code == expected if expected else code not in (12, 122)
    target = with_place(root)
    assert code_of(mirror.modify_ext_s, target, describe(b"x"),
                   [AssertionControl(False, "(cn=*)")]) == 122


def test_ldapmodify_asserts_and_reads(server, root):
    dn = with_place(root, description=["old"])
    change_text = "dn: %s\nchangetype: modify\nreplace: description\ndescription: new\n" % dn

    def modify(*options):
        return subprocess.run(
            ["ldapmodify", "-x", "-H", server.url, "-D", clients.ADMINISTRATOR, "-y",
             str(server.directory / "admin.pw"), *options], input=change_text.encode(),
            stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE, check=False)

    assert modify("-e", "!assert=(description=other)").returncode == 122
    done = modify("-e", "!assert=(description=old)", "-e", "!preread=description", "-e",
                  "!postread=description")
    assert done.returncode == 0, done.stderr
    assert b"description: old" in done.stdout
    assert b"description: new" in done.stdout


# ---- paged results

class Pages:
    """A search of all below a base, page by page."""

    def __init__(self, client, base=clients.BASE, filter_text="(objectClass=*)", attributes=("1.1",),
                 size_limit=0):
        self.client, self.base, self.filter_text = client, base, filter_text
        self.attributes, self.size_limit = list(attributes), size_limit
        self.cookie = b""
        self.total = None

    def next(self, size, cookie=None, critical=True):
        """The names on the next page; takes the cookie of the one before, unless told otherwise."""
        control = SimplePagedResultsControl(
            critical, size=size, cookie=self.cookie if cookie is None else cookie)
        message = self.client.search_ext(self.base, ldap.SCOPE_SUBTREE, self.filter_text,
                                         self.attributes, serverctrls=[control],
                                         sizelimit=self.size_limit)
        _, entries, _, controls = self.client.result3(message, timeout=DEADLINE)
        answered = control_of(controls, SimplePagedResultsControl)
        self.cookie = answered.cookie if answered else None
        self.total = answered.size if answered else None
        return [clients.dn_key(dn) for dn, _ in entries]

    def all(self, size):
        found = self.next(size)
        while self.cookie:
            page = self.next(size)
            assert len(page) == size or not self.cookie
            found += page
        return found


@pytest.mark.parametrize("size", [1, 2, 7, 1000, 2 ** 31 - 1])
def test_pages_show_every_entry_once(root, size):
    everything = clients.names(root, "(objectClass=*)")
    pages = Pages(root)
    found = pages.all(size)
    assert len(found) == len(set(found)) == pages.total
    assert set(found) == everything


def test_pages_show_the_configuration_of_one_moment(root):
    everything = clients.names(root, "(objectClass=*)")
    pages = Pages(root)
    found = pages.next(3)
    assert add(root, *container("later")) == 0
    root.delete_s("cn=digest,cn=configuration")
    while pages.cookie:
        found += pages.next(3)
    assert set(found) == everything


def test_ldapsearch_fetches_pages(server):
    plain = clients.command("ldapsearch", server, "-LLL", "-b", clients.BASE, "1.1")
    paged = clients.command("ldapsearch", server, "-LLL", "-b", clients.BASE, "-E",
                            "!pr=4/noprompt", "1.1")
    assert paged.returncode == 0, paged.stderr
    names = [[line for line in answer.stdout.splitlines() if line.startswith(b"dn:")]
             for answer in (plain, paged)]
    assert sorted(names[1]) == sorted(names[0])
    assert b"# pagedresults: estimate=%d " % len(names[0]) in paged.stdout


def test_a_cookie_is_good_once(root):
    pages = Pages(root)
    pages.next(2)
    first = pages.cookie
    pages.next(2)
    second = pages.cookie
    assert code_of(pages.next, 2, first) == 53
    assert pages.next(2, second)


def test_a_cookie_that_nobody_gave_out_is_refused(server, root):
    other = Pages(clients.bind(server))
    other.next(2)
    for cookie in (b"x", b"\0" * 16, b"x" * 5000, other.cookie):
        assert code_of(Pages(root).next, 2, cookie) == 53
    assert other.next(2)


@pytest.mark.parametrize("change_of", [
    {"base": GROUP}, {"filter_text": "(cn=*)"}, {"attributes": ("cn",)}, {"attributes": ("1.1", "cn")}])
def test_a_cookie_is_good_for_its_search_only(root, change_of):
    pages = Pages(root)
    pages.next(2)
    assert code_of(Pages(root, **change_of).next, 2, pages.cookie) == 53
    assert code_of(pages.next, 2) == 53


def test_a_cookie_ends_with_a_bind(server, root):
    pages = Pages(root)
    pages.next(2)
    root.simple_bind_s(clients.ADMINISTRATOR, server.password)
    assert code_of(pages.next, 2) == 53


def test_page_size_0_ends_a_search(root):
    pages = Pages(root)
    pages.next(2)
    cookie = pages.cookie
    assert pages.next(0) == []
    assert pages.cookie == b""
    assert code_of(pages.next, 2, cookie) == 53


def test_page_size_0_at_first_tells_how_many_there_are(root):
    pages = Pages(root)
    assert pages.next(0) == []
    assert (pages.cookie, pages.total) == (b"", len(clients.names(root, "(objectClass=*)")))


def test_a_negative_page_size_is_refused(root):
    assert code_of(Pages(root).next, -1) == 2


def test_a_size_limit_within_the_first_page_makes_the_control_mean_nothing(root):
    for size in (3, 4):
        pages = Pages(root, size_limit=3)
        assert code_of(pages.next, size) == 4


def test_a_size_limit_is_for_all_pages_together(root):
    pages = Pages(root, size_limit=5)
    assert len(pages.next(2)) == 2
    assert len(pages.next(2)) == 2
    assert code_of(pages.next, 2) == 4


def test_more_open_searches_than_there_may_be_forget_the_oldest(root):
    root.modify_s(clients.BASE, [(ldap.MOD_REPLACE, "orv-slapdMaxPagedSearches", [b"2"])])
    pages = [Pages(root) for _ in range(3)]
    for each in pages:
        each.next(2)
    assert code_of(pages[0].next, 2) == 53
    assert pages[1].next(2) and pages[2].next(2)


def test_what_may_be_kept_is_bounded(root):
    root.modify_s(clients.BASE, [(ldap.MOD_REPLACE, "orv-slapdMaxPagedResultSize", [b"4096"])])
    pages = Pages(root, attributes=("*",))
    found = pages.next(1)
    with pytest.raises(ldap.ADMINLIMIT_EXCEEDED):
        while pages.cookie:
            found += pages.next(1)


def test_strangers_get_no_pages(server):
    assert code_of(Pages(clients.connect(server)).next, 2) == 50
    assert code_of(Pages(clients.connect(server)).next, 2, b"x" * 16) == 50


def test_hidden_attributes_are_on_no_page(server, root):
    bob = bind_member(server, root, "bob")
    bind_member(server, root, "alice")
    control = SimplePagedResultsControl(True, size=1, cookie="")
    while True:
        message = bob.search_ext(clients.BASE, ldap.SCOPE_SUBTREE, serverctrls=[control])
        _, entries, _, controls = bob.result3(message, timeout=DEADLINE)
        for dn, attributes in entries:
            assert "orv-slapdAdminPW" not in attributes or dn.lower().startswith("cn=bob,")
        control.cookie = control_of(controls, SimplePagedResultsControl).cookie
        if not control.cookie:
            break


def test_published_entries_are_one_page(root):
    control = SimplePagedResultsControl(True, size=1, cookie="")
    for base in ("", "cn=subschema"):
        message = root.search_ext(base, ldap.SCOPE_BASE, serverctrls=[control])
        _, entries, _, controls = root.result3(message, timeout=DEADLINE)
        assert len(entries) == 1
        assert control_of(controls, SimplePagedResultsControl).cookie == b""


# ---- logs

def test_the_access_log_names_what_was_asked(instance):
    instance.config.set("CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION", "orv-slapdLogLevel", "info")
    instance.start()
    root = clients.bind(instance)
    dn = with_place(root)
    root.whoami_s()
    code_of(root.extop_s, cancel(99))
    root.modify_ext_s(dn, describe(b"x"), [AssertionControl(True, "(cn=shelf)"),
                                           PreReadControl(True, ["cn"])])
    pages = Pages(root)
    pages.next(2)
    pages.next(2)
    root.unbind_s()
    instance.stop()
    log = instance.access_log.read_text()
    assert re.search(r"WHOAMI result=0", log)
    assert re.search(r"CANCEL id=99 result=119", log)
    assert re.search(r"MODIFY dn=\S+ assertion pre-read result=0", log)
    assert re.search(r"SEARCH .* page=2 result=0 entries=2", log)
    assert re.search(r"SEARCH .* page=2 next result=0 entries=2", log)
