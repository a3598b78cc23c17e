"""A server in the environment of a Turkish user, whose letters i and I are no pair: names are what
they are everywhere, and text keeps the letters of the language.

The locales are made for the test: a bare machine has none but "C".
"""

import os
import subprocess
import sys

import pytest

from orv_e2e import changes, clients, programs
from orv_e2e.changes import GROUP, LOGS, add, added, deleted, delete, member, modify, replaced

TOP = "cn=configuration"
CONFIG_DB = "cn=ConfigDB,cn=Config Backends,cn=ORV Directory,cn=Schemas,cn=Configuration"
LETTERS = "\u0130\u0131\u015f\u015e\u011f\u011e"  # dotted capital, dotless small, and others
TAKE_OVER = """
import locale
locale.setlocale(locale.LC_ALL, "")
print(locale.nl_langinfo(locale.CODESET))
"""


@pytest.fixture(scope="session", name="locales")
def locales_fixture(tmp_path_factory):
    folder = tmp_path_factory.mktemp("locales")
    for name, character_set in (("tr_TR.utf8", "UTF-8"), ("tr_TR.iso88599", "ISO-8859-9")):
        subprocess.run(["localedef", "--no-archive", "-i", "tr_TR", "-f", character_set,
                        str(folder / name)], check=True, timeout=programs.DEADLINE,
                       stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    return folder


@pytest.fixture(params=["UTF-8", "ISO-8859-9"], name="turkish")
def turkish_fixture(request, instance, locales):
    """A server whose environment names the locale, and a code page by it."""
    environment = {"LC_ALL": "tr_TR." + request.param, "LOCPATH": str(locales)}
    # A locale that is not there would be none, and the test say nothing.
    found = subprocess.run([sys.executable, "-c", TAKE_OVER], check=True, stdout=subprocess.PIPE,
                           env={**os.environ, **environment}, timeout=programs.DEADLINE)
    assert found.stdout.decode().strip() == request.param
    instance.encoding = request.param
    return instance.start(environment=environment)


@pytest.fixture(name="root")
def root_fixture(turkish):
    client = clients.bind(turkish)
    yield client
    client.unbind_s()


def test_entry_of_the_configuration_database_stays_under_every_letter_case(turkish, root):
    before = turkish.config.read()
    for dn in (CONFIG_DB, CONFIG_DB.upper(), CONFIG_DB.lower()):
        assert delete(root, dn) == 53
    assert turkish.config.read() == before


def test_letters_of_types_classes_and_roles_are_pairs(turkish, root):
    assert modify(root, TOP.upper(), replaced("ORV-SLAPDSIZELIMIT", "1000")) == 0
    assert modify(root, TOP, replaced("ORV-SLAPDIPADDRESS", "192.0.2.1")) == 19
    dn, attributes = member("ali", roles=["AUDITADMIN", "schemaadmin"])
    attributes["objectClass"] = [name.upper() for name in attributes["objectClass"]]
    attributes["orv-slapdKrbAdminDN"] = ["ORV-KN=ali@EXAMPLE.COM"]
    assert add(root, dn, attributes) == 0
    ali = clients.bind(turkish, "CN=ALI", changes.PASSWORD)
    assert modify(ali, "cn=audit," + LOGS, replaced("description", "x")) == 0
    assert modify(ali, TOP, replaced("ORV-SLAPDADMINDN", "cn=ali too")) == 50
    assert add(root, *member("veli", bind_dn="CN=ALI")) == 68
    assert add(root, *member("veli", KrbAdminDN="orv-kn=ALI@EXAMPLE.COM")) == 68
    assert modify(root, dn, deleted("orv-slapdAdminRole", "AuditAdmin", "SCHEMAADMIN")) == 0
    stored = clients.parse_ldif(turkish.config.read())[dn]
    assert stored["orv-slapdAdminRole"] == [b"NoAdmin"]


def test_no_other_log_is_the_file_of_the_audit_log_in_capitals(turkish, root):
    file = turkish.directory / "log" / "audit.log"
    before = turkish.config.read()
    assert modify(root, "cn=access," + LOGS,
                  replaced("orv-slapdLog", str(file).replace("audit", "AUDIT"))) == 53
    assert turkish.config.read() == before


def test_letters_of_the_language_are_letters_of_a_password(turkish, root):
    password = "\u0131\u015f\u011f\u00fc\u00f6\u00e7\u0130\u015e-.12,34"
    assert modify(root, "cn=pwdpolicy admin," + TOP, replaced("passwordMinAlphaChars", "8"),
                  replaced("pwdMinLength", "14")) == 0
    assert add(root, *member("veli", password=password.replace("\u0131", "5"))) == 19
    assert add(root, *member("ali", password=password)) == 0
    ali = clients.bind(turkish, "cn=ali", password)
    assert modify(ali, "cn=ali," + GROUP, replaced("orv-slapdAdminPW", "AbCdEfGh=?67+89")) == 0
    clients.bind(turkish, "cn=ali", "AbCdEfGh=?67+89").unbind_s()


def test_text_of_the_language_is_kept_in_the_code_page_of_the_locale(turkish, root):
    dn, attributes = changes.container("shelf", description=["one"])
    assert add(root, dn, attributes) == 0
    assert modify(root, dn, added("description", LETTERS)) == 0
    assert clients.read(root, dn)["description"] == [b"one", LETTERS.encode()]
    assert clients.names(root, "(description=%s)" % LETTERS) == {dn}
    stored = clients.parse_ldif(turkish.config.read())[dn]
    assert stored["description"] == [b"one", LETTERS.encode(turkish.encoding)]
    beyond = modify(root, dn, added("description", "\u65e5\u672c"))
    assert beyond == (0 if turkish.encoding == "UTF-8" else 21)
