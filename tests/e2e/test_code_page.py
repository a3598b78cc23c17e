"""A configuration file in another code page than UTF-8."""

import base64

import pytest

from orv_e2e import clients, wire
from orv_e2e.config_file import record
from orv_e2e.persistent import DELETE, Listener

SHELF = "cn=shelf,cn=schemas,cn=configuration"
TEXT = "Café Ærø für 5 £"
CONTAINER = [("objectClass", ["top", "container"]), ("cn", "shelf")]


def shelf_in_latin_1(instance):
    instance.config.append(record(SHELF, [*CONTAINER, ("description", TEXT.encode("latin-1"))]))
    return instance


def latin_1(instance):
    return shelf_in_latin_1(instance).start("--code-page", "ISO-8859-1")


def test_text_of_the_file_comes_to_the_client_in_utf_8(instance):
    client = clients.bind(latin_1(instance))
    assert clients.read(client, SHELF)["description"] == [TEXT.encode("utf-8")]


def test_text_in_base64_comes_to_the_client_in_utf_8(instance):
    encoded = base64.b64encode(TEXT.encode("latin-1"))
    instance.config.append(record(SHELF, CONTAINER) + b"description:: " + encoded + b"\n")
    instance.start("--code-page", "ISO-8859-1")
    assert clients.read(clients.bind(instance), SHELF)["description"] == [TEXT.encode("utf-8")]


@pytest.mark.parametrize("filter_text", ["(description=" + TEXT + ")", "(description=*Ærø*)",
                                         "(description=caf*)"])
def test_filter_of_the_client_finds_text_of_the_file(instance, filter_text):
    client = clients.bind(latin_1(instance))
    assert clients.names(client, filter_text) == {SHELF}


def test_base_beyond_ascii_is_found(instance):
    dn = "cn=Ærø,cn=schemas,cn=configuration"
    instance.config.append(record(dn.encode("latin-1"), [
        ("objectClass", ["top", "container"]), ("cn", "Ærø".encode("latin-1"))]))
    client = clients.bind(instance.start("--code-page", "ISO-8859-1"))
    assert clients.read(client, dn)["cn"] == ["Ærø".encode("utf-8")]
    assert dn.lower() in clients.search(client, "cn=ærø,cn=schemas,cn=configuration")


def test_base_that_the_code_page_cannot_hold_is_refused_and_serving_goes_on(instance):
    latin_1(instance)
    with wire.bound(instance) as connection:
        code, entries = connection.search(2, base="cn=日本,cn=configuration")
        assert code in (21, 32, 34) and entries == 0
        assert connection.search(3) == (0, 1)


def test_administrator_binds_whatever_the_code_page(instance):
    clients.bind(latin_1(instance))


@pytest.mark.parametrize("filter_text", ["(description=" + TEXT + ")", "(description=*Ærø*)",
                                         "(description=caf*)"])
def test_deletion_is_told_to_who_asked_for_text_of_the_file(instance, filter_text):
    latin_1(instance)
    root = clients.bind(instance)
    listener = Listener(clients.bind(instance), filter_text=filter_text).established()
    # Bytes of the file's text, taken for characters: what nobody asked for must not be told.
    mistaken = TEXT.encode("utf-8").decode("latin-1")
    other = Listener(clients.bind(instance),
                     filter_text="(description=" + mistaken + ")").established()
    root.delete_s(SHELF)
    dn, attributes, change = listener.next()
    assert (dn, change) == (SHELF, DELETE)
    assert attributes["description"] == [TEXT.encode("utf-8")]
    other.established()
    assert not other.has_heard()


def test_unknown_code_page_is_refused_at_start(instance):
    exit_code, stderr = instance.start_refused("--code-page", "KLINGON-1")
    assert exit_code == 1
    assert "KLINGON-1" in stderr


def test_bytes_that_are_not_utf_8_are_refused_or_hidden_but_never_sent(instance):
    """The default code page is UTF-8; a client must not get text that is none."""
    shelf_in_latin_1(instance)
    try:
        instance.start()
    except Exception:  # pylint: disable=broad-except
        return
    found = clients.search(clients.bind(instance), SHELF)
    for value in found.get(SHELF, {}).get("description", []):
        value.decode("utf-8")
