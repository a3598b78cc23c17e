"""Odd values: each is stored exactly and read back the same, or refused; none harms the file."""

import base64
import os

import ldap
import pytest

from orv_e2e import changes, clients
from orv_e2e.changes import PLACE, add, container, delete


def stored(instance, dn):
    return clients.parse_ldif(instance.config.read())[clients.dn_key(dn)]


@pytest.mark.parametrize("value", [
    b"two\nlines", b"\n", b" leading", b"trailing ", b":colon", b"<url", b"#hash", b"-",
    b"tab\there", b"\r\n", b"caf\xc3\xa9", "\U0001f600 \u0130".encode(), b"x" * 200, b"\x7f",
    b"\xc2\xa0", b"dn: cn=x,cn=configuration", b"objectClass: top\n\ndn: cn=evil"])
def test_value_is_stored_exactly(server, root, value):
    dn, attributes = container("odd")
    before = server.config.read()
    assert add(root, dn, list(attributes.items()) and changes.encoded(attributes)
               + [("description", [value])]) == 0
    assert clients.read(root, dn)["description"] == [value]
    assert stored(server, dn)["description"] == [value]
    assert delete(root, dn) == 0
    assert server.config.read() == before


@pytest.mark.parametrize("value", [b"\xff", b"\xc3(", b"\xed\xa0\x80", b"\xc0\x80", b"nul\0", b"\0",
                                   b"orv-replicationContext\0", b""])
def test_value_that_cannot_be_held_is_refused_with_a_reason(server, root, value):
    before = server.config.read()
    dn, attributes = container("odd")
    assert add(root, dn, changes.encoded(attributes) + [("description", [value])]) == 21
    assert server.config.read() == before
    assert server.stderr.wait_for(lambda line: "warning" in line and "description" in line)


@pytest.mark.parametrize("values, code", [
    ([b"x", b"x"], 20), ([b"x", b"X"], 20), ([b"a b", b"a  b"], 20), ([b"a", b" a "], 20),
    (["\u00e9".encode(), "e\u0301".encode()], 20), ([b"x", b"y"], 0)])
def test_equal_values_are_refused(server, root, values, code):
    dn, attributes = container("equal")
    assert add(root, dn, changes.encoded(attributes) + [("description", values)]) == code


def test_same_type_under_two_names_is_refused(server, root):
    dn, attributes = container("twice")
    assert add(root, dn, changes.encoded(attributes) + [("2.5.4.3", [b"other"])]) == 20
    assert add(root, dn, changes.encoded(attributes) + [("CN", [b"other"])]) == 20


def test_entry_grows_up_to_its_limits_and_the_connection_goes_on(instance):
    instance.config.set(clients.BASE, "orv-slapdMaxValues", "40")
    instance.config.set(clients.BASE, "orv-slapdMaxAttributes", "5")
    instance.start()
    root = clients.bind(instance)
    words = ["%d" % number for number in range(60)]
    dn, attributes = container("big", description=words[:20])
    assert add(root, dn, attributes) == 0
    assert changes.modify(root, dn, (ldap.MOD_ADD, "description", words[20:30])) == 0
    before = instance.config.read()
    assert changes.modify(root, dn, (ldap.MOD_ADD, "description", words[30:40])) == 11
    assert instance.config.read() == before
    assert instance.stderr.wait_for(lambda line: "more than 40 values" in line)
    assert changes.modify(root, dn, (ldap.MOD_DELETE, "description", words[:10]),
                          (ldap.MOD_ADD, "description", words[30:40])) == 0
    dn, attributes = container("huge", description=words)
    assert add(root, dn, attributes) == 11
    dn, attributes = changes.member("alice")  # five
    assert add(root, dn, attributes) == 0
    assert changes.modify(root, dn, (ldap.MOD_ADD, "orv-slapdDigestAdminUser", ["alice"])) == 11
    assert instance.stderr.wait_for(lambda line: "more than 5 attributes" in line)
    assert clients.bind(instance, "cn=alice", changes.PASSWORD)


def test_value_of_almost_a_megabyte_is_stored_exactly(server, root):
    value = base64.b64encode(os.urandom(760_000))
    dn, attributes = container("large", description=[value])
    assert add(root, dn, attributes) == 0
    assert clients.read(root, dn)["description"] == [value]


def test_value_beyond_the_message_limit_ends_the_connection_only(server, root):
    client = clients.bind(server)
    dn, attributes = container("too large", description=["x" * (2 << 20)])
    assert add(client, dn, attributes) != 0
    assert clients.read(root, clients.BASE)


def test_ten_thousand_values_are_stored_in_their_order(server, root):
    # With those of the classes and the name they are as many as one message may hold.
    values = ["value %d" % number for number in range(9_997)]
    dn, attributes = container("many", description=values)
    assert add(root, dn, attributes) == 0
    assert clients.read(root, dn)["description"] == [value.encode() for value in values]
    dn, attributes = container("too many", description=values + ["one more"])
    assert add(root, dn, attributes) != 0


def test_attributes_in_any_order_make_the_same_entry(server, root):
    dn, attributes = changes.member("carol")
    assert add(root, dn, list(reversed(changes.encoded(attributes)))) == 0
    assert clients.read(root, dn)["objectClass"] == [
        name.encode() for name in attributes["objectClass"]]
    client = clients.bind(server, "cn=carol", changes.PASSWORD)
    client.unbind_s()


@pytest.mark.parametrize("dn", [
    "cn=comma\\, here," + PLACE, "cn=plus\\+equals\\=quote\\\"," + PLACE,
    "cn=\\ blank around\\ ," + PLACE, "cn=\\#hash," + PLACE, "cn=back\\\\slash," + PLACE,
    "cn=caf\u00e9," + PLACE, "cn=x\\2ccn=admingroup," + PLACE, "cn=new\\0aline," + PLACE,
    "cn=a+description=b," + PLACE])
def test_name_is_stored_as_written_and_found_again(server, root, dn):
    before = server.config.read()
    assert add(root, dn, {"objectClass": ["top", "container"]}) == 0
    assert add(root, dn, {"objectClass": ["top", "container"]}) == 68
    [(found, attributes)] = root.search_s(dn, ldap.SCOPE_BASE)
    assert ldap.dn.str2dn(found)[0] == ldap.dn.str2dn(dn)[0]
    value = ldap.dn.str2dn(dn)[0][0][1].encode()
    assert value in attributes["cn"]
    assert delete(root, dn) == 0
    assert server.config.read() == before


@pytest.mark.parametrize("dn, code", [
    ("orv-slapdAdminPW=secret," + PLACE, 64), ("cn=x+orv-slapdMasterPW=secret," + PLACE, 64),
    ("1.2.3.4=x," + PLACE, 17), ("cn=nul\\00," + PLACE, 34), ("cn=\\ff," + PLACE, 34),
    ("cn=x;" + PLACE, 34), ("cn=," + PLACE, 21), ("cn;lang-en=x," + PLACE, 34)])
def test_name_that_cannot_be_held_is_refused(server, root, dn, code):
    before = server.config.read()
    assert add(root, dn, {"objectClass": ["top", "container"], "cn": ["x"]}) == code
    assert server.config.read() == before


@pytest.mark.parametrize("classes, code", [
    (["top", "container", "noSuchClass"], 65), (["top"], 65), (["top", "container", "2.5.6.0"], 20),
    (["top", "container", "orv-slapdSupplier"], 65), (["top", "referral"], 65),
    (["top", "container", "orv-replicationContext"], 92)])
def test_classes_that_do_not_fit_are_refused(server, root, classes, code):
    assert add(root, "cn=odd," + PLACE, {"objectClass": classes, "cn": ["odd"]}) == code


def test_second_value_of_a_single_valued_type_and_a_type_of_another_class_are_refused(server, root):
    dn, attributes = changes.member("carol")
    attributes["orv-slapdAdminDN"].append("cn=second")
    assert add(root, dn, attributes) == 19
    dn, attributes = container("odd", **{"orv-slapdPort": ["1"]})
    assert add(root, dn, attributes) == 65


def test_attribute_that_only_the_server_sets_is_refused(server, root):
    dn, attributes = container("odd", createTimestamp=["20260101000000Z"])
    assert add(root, dn, attributes) == 19


def test_password_in_a_stored_form_is_refused_and_a_clear_one_is_never_in_the_file(server, root):
    administrator = clients.parse_ldif(server.config.read())[clients.BASE]["orv-slapdAdminPW"][0]
    for given in (administrator.decode(), "{SSHA512}AAAAAAAAAAAA", "{clear}Vx7#kq9!Zp3$"):
        assert add(root, *changes.member("copied", password=given)) == 19
    assert add(root, *changes.member("carol")) == 0
    assert changes.PASSWORD.encode() not in server.config.read()
    value = stored(server, "cn=carol," + changes.GROUP)["orv-slapdAdminPW"][0]
    assert value.startswith(b"{")


@pytest.fixture(name="latin")
def latin_fixture(instance):
    """A server whose file is not in UTF-8."""
    instance.start("--code-page", "ISO-8859-1")
    client = clients.bind(instance)
    yield instance, client
    client.unbind_s()


def test_text_is_kept_in_the_code_page_of_the_file(latin):
    instance, root = latin
    dn, attributes = container("latin", description=["caf\u00e9"])
    assert add(root, dn, attributes) == 0
    assert b"caf\xe9" in instance.config.read() or b"Y2Fm6Q==" in instance.config.read()
    assert clients.read(root, dn)["description"] == ["caf\u00e9".encode()]


def test_text_outside_the_code_page_of_the_file_is_refused(latin):
    instance, root = latin
    before = instance.config.read()
    dn, attributes = container("odd", description=["price \u20ac", "plain"])
    with pytest.raises(ldap.INVALID_SYNTAX, match="character 7 .*description"):
        root.add_s(dn, changes.encoded(attributes))
    assert add(root, "cn=\u20ac," + PLACE, {"objectClass": ["top", "container"]}) in (21, 34)
    assert instance.config.read() == before


def test_name_outside_ascii_is_added_once_in_another_code_page(latin):
    instance, root = latin
    dn = "cn=caf\u00e9," + PLACE
    assert add(root, dn, {"objectClass": ["top", "container"]}) == 0
    after = instance.config.read()
    assert add(root, "CN=CAF\u00c9," + PLACE, {"objectClass": ["top", "container"]}) == 68
    assert instance.config.read() == after
    [(_, attributes)] = root.search_s(dn, ldap.SCOPE_BASE)
    assert attributes["cn"] == ["caf\u00e9".encode()]


def test_names_outside_ascii_are_not_deleted_in_another_code_page(latin):
    _, root = latin
    assert delete(root, "cn=caf\u00e9," + PLACE) == 34
