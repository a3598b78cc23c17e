"""DIGEST-MD5, SCRAM-SHA-256 and GSSAPI, with ldapsearch, ldapmodify and a KDC of MIT Kerberos."""

import os
import signal
import subprocess

import ldap
import ldap.sasl
import pytest

from orv_e2e import clients, kerberos, wire
from orv_e2e.changes import GROUP, PASSWORD, add, member, modify, replaced
from orv_e2e.kerberos import with_kerberos
from orv_e2e.programs import DEADLINE, orvcfg

BY_PASSWORD = ["DIGEST-MD5", "SCRAM-SHA-256"]
DIGEST = "cn=digest,cn=configuration"
KERBEROS = "cn=kerberos,cn=configuration"
POLICY = "cn=pwdpolicy admin,cn=configuration"


def ldapsearch(url, *arguments, environment=None):
    return subprocess.run(
        ["ldapsearch", "-LLL", "-N", "-H", url, *arguments, "-b", "cn=configuration", "-s", "base",
         "orv-slapdAdminPW"], stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE,
        check=False, env=environment or os.environ)


def by_password(url, mechanism, user, password, *more):
    return ldapsearch(url, "-Q", "-Y", mechanism, "-U", user, "-w", password, *more)


def is_root(found):
    """Whether the search ran, as somebody who sees passwords."""
    return found.returncode == 0 and b"orv-slapdAdminPW" in found.stdout


def is_refused(found):
    return found.returncode == 49 and b"Invalid credentials (49)" in found.stderr


def announced(client):
    found = client.search_s("", ldap.SCOPE_BASE, attrlist=["supportedSASLMechanisms"])[0][1]
    return [name.decode() for name in found.get("supportedSASLMechanisms", [])]


def reload(server):
    """Has the settings taken over."""
    seen = len(server.stderr.lines())
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "settings taken over" in line, start=seen)


def credentials(mechanism, user, password, authorization_id=""):
    return ldap.sasl.sasl({ldap.sasl.CB_AUTHNAME: user, ldap.sasl.CB_PASS: password,
                           ldap.sasl.CB_USER: authorization_id}, mechanism)


def bind(server, mechanism, user, password, authorization_id=""):
    client = clients.connect(server)
    client.sasl_interactive_bind_s("", credentials(mechanism, user, password, authorization_id))
    return client


def sasl_step(client, mechanism, text):
    """The result of one request of a bind by hand; `text` may be absent."""
    method = wire.octets(mechanism) + (b"" if text is None else wire.octets(text))
    client.send(wire.message(1, wire.tlv(
        wire.BIND, wire.number(3) + wire.octets("") + wire.tlv(0xA3, method))))
    answer = client.answer()
    assert answer is not None and answer.tag == wire.BIND_RESPONSE
    return answer.code


@pytest.fixture
def named(root, server):
    """A server whose primary administrator is "boss"."""
    assert modify(root, DIGEST, replaced("orv-slapdDigestAdminUser", "boss")) == 0
    return server


# ---- user names and passwords

@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_ldapsearch_binds_the_primary_administrator_by_its_user_name(named, mechanism):
    assert is_root(by_password(named.url, mechanism, "boss", named.password))
    assert is_refused(by_password(named.url, mechanism, "boss", "wrong"))
    assert is_refused(by_password(named.url, mechanism, "nobody", named.password))
    assert is_refused(by_password(named.url, mechanism, "Boss", named.password))
    named.stop()
    log = named.access_log.read_text()
    assert 'sasl mechanism="%s" name="boss" as="CN=ROOT" result=0' % mechanism in log
    assert 'sasl mechanism="%s" name="nobody" result=49' % mechanism in log


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_members_bind_by_theirs(server, root, mechanism):
    assert modify(root, DIGEST, replaced("orv-slapdDigestAdminUser", "boss")) == 0
    assert add(root, *member("alice", DigestAdminUser="alice@work", roles=["AuditAdmin"])) == 0
    found = by_password(server.url, mechanism, "alice@work", PASSWORD)
    assert found.returncode == 0, found.stderr
    client = bind(server, mechanism, "alice@work", PASSWORD)
    # What her role gives, and no more.
    assert modify(client, DIGEST, replaced("orv-slapdDigestAdminUser", "x")) == 50
    # Switched off, members are nobody.
    assert modify(root, clients.BASE, replaced("orv-slapdAdminGroupEnabled", "FALSE")) == 0
    assert is_refused(by_password(server.url, mechanism, "alice@work", PASSWORD))


def test_password_that_is_hashed_is_refused_like_a_wrong_one_and_the_log_says_why(named, root):
    assert modify(root, clients.BASE, replaced("orv-slapdPwEncryption", "ssha512")) == 0
    assert add(root, *member("alice", DigestAdminUser="alice")) == 0
    for _ in range(2):
        for mechanism in BY_PASSWORD:
            assert is_refused(by_password(named.url, mechanism, "alice", PASSWORD))
    named.stop()
    lines = [line for line in named.stderr.text().splitlines() if "not hashed" in line]
    assert len(lines) == 1
    assert "CN=ALICE,CN=ADMINGROUP,CN=CONFIGURATION" in lines[0]


def test_mechanisms_that_cannot_work_are_not_announced(server, root):
    client = clients.connect(server)
    assert announced(client) == []
    assert ldapsearch(server.url, "-Q", "-Y", "GSSAPI").returncode != 0
    assert modify(root, DIGEST, replaced("orv-slapdDigestAdminUser", "boss")) == 0
    assert announced(client) == ["SCRAM-SHA-256", "DIGEST-MD5"]
    # A hashed password serves neither.
    assert modify(root, clients.BASE, replaced("orv-slapdPwEncryption", "ssha512")) == 0
    assert modify(root, clients.BASE, replaced("orv-slapdAdminPW", PASSWORD)) == 0
    assert announced(client) == []


def test_mechanisms_are_switched_off_by_a_setting(named, root):
    def allow(*names):
        assert modify(root, GROUP, replaced("orv-slapdSaslMechanisms", *names)) == 0
        reload(named)

    local = ldap.initialize(named.local_url)
    assert announced(local) == ["EXTERNAL", "SCRAM-SHA-256", "DIGEST-MD5"]
    allow("scram-sha-256")
    assert announced(local) == ["SCRAM-SHA-256"]
    assert not is_root(by_password(named.url, "DIGEST-MD5", "boss", named.password))
    assert is_root(by_password(named.url, "SCRAM-SHA-256", "boss", named.password))
    allow("none")
    assert announced(local) == []
    allow("EXTERNAL", "DIGEST-MD5")
    assert announced(local) == ["EXTERNAL", "DIGEST-MD5"]
    assert modify(root, GROUP, replaced("orv-slapdSaslMechanisms", "PLAIN")) == 19


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_nobody_acts_as_anybody_else(named, root, mechanism):
    assert add(root, *member("alice", DigestAdminUser="alice")) == 0
    for allowed in ("u:boss", "dn:cn=root", "dn: CN = ROOT "):
        assert is_root(by_password(named.url, mechanism, "boss", named.password, "-X", allowed))
    for refused in ("u:alice", "u:Boss", "dn:cn=alice", "dn:", "dn:x", "x:boss"):
        found = by_password(named.url, mechanism, "boss", named.password, "-X", refused)
        assert is_refused(found), refused
    assert is_refused(by_password(named.url, mechanism, "alice", PASSWORD, "-X", "u:boss"))


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_failed_binds_lock_out(named, root, mechanism):
    assert modify(root, POLICY, replaced("pwdMaxFailure", "3")) == 0
    for _ in range(3):
        assert is_refused(by_password(named.url, mechanism, "boss", "wrong"))
    for _ in range(2):
        assert is_refused(by_password(named.url, mechanism, "boss", named.password))
        with pytest.raises(ldap.INVALID_CREDENTIALS):
            clients.bind(named)


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_binds_that_succeed_forget_the_failures(named, root, mechanism):
    assert modify(root, POLICY, replaced("pwdMaxFailure", "2")) == 0
    for _ in range(3):
        assert is_refused(by_password(named.url, mechanism, "boss", "wrong"))
        assert is_root(by_password(named.url, mechanism, "boss", named.password))


@pytest.mark.parametrize("mechanism", BY_PASSWORD)
def test_connection_ends_when_the_name_is_taken_away(named, root, mechanism):
    client = bind(named, mechanism, "boss", named.password)
    assert "orv-slapdAdminPW" in clients.read(client, clients.BASE)
    assert modify(root, DIGEST, replaced("orv-slapdDigestAdminUser", "other")) == 0
    with pytest.raises(ldap.LDAPError):
        clients.read(client, clients.BASE)


def test_realm_is_named_by_a_setting(named, root):
    assert modify(root, DIGEST, replaced("orv-slapdDigestRealm", "The Realm")) == 0
    assert modify(root, DIGEST, replaced("orv-slapdDigestRealm", 'a",qop="auth')) == 19
    reload(named)
    assert is_root(by_password(named.url, "DIGEST-MD5", "boss", named.password, "-R", "The Realm"))
    assert is_root(by_password(named.url, "DIGEST-MD5", "boss", named.password))


def test_realm_that_could_not_be_quoted_is_refused_at_the_start(instance):
    text = instance.config.path.read_text()
    instance.config.path.write_text(
        text.replace("\ncn: Digest\n", '\ncn: Digest\norv-slapdDigestRealm: a"b\n'))
    status, errors = instance.start_refused()
    assert status == 1
    assert "orv-slapdDigestRealm is not 1 to 255" in errors
    checked = subprocess.run([orvcfg(), "check", instance.config.path], check=False,
                             stdout=subprocess.PIPE, stderr=subprocess.STDOUT, timeout=DEADLINE)
    assert checked.returncode == 1 and b"orv-slapdDigestRealm" in checked.stdout


# ---- security layers

def test_large_tree_arrives_whole_through_layers(named, root):
    for number in range(40):
        assert add(root, "cn=e%d,cn=schemas,cn=configuration" % number,
                   {"objectClass": ["top", "container"], "cn": ["e%d" % number],
                    "description": ["x" * 20000 + str(number)]}) == 0
    for strength in ("minssf=1,maxssf=1", "minssf=1", "maxssf=0"):
        found = subprocess.run(
            ["ldapsearch", "-LLL", "-Q", "-o", "ldif-wrap=no", "-Y", "DIGEST-MD5", "-U", "boss",
             "-w", named.password, "-O", strength, "-H", named.url, "-b",
             "cn=schemas,cn=configuration", "(description=*)", "description"],
            stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE, check=False)
        assert found.returncode == 0, found.stderr
        for number in range(40):
            assert b"x" * 20000 + str(number).encode() + b"\n" in found.stdout


def test_ciphers_of_digest_are_not_offered(named):
    for strength in ("minssf=2,maxssf=56", "minssf=112", "minssf=128,maxssf=128"):
        found = by_password(named.url, "DIGEST-MD5", "boss", named.password, "-O", strength)
        assert found.returncode != 0, found.stdout


def test_no_layer_is_offered_inside_tls_and_over_the_socket(named):
    trusting = {**os.environ, "LDAPTLS_CACERT": str(named.certificate)}
    trusting.pop("LDAPNOINIT", None)
    for url, options in ((named.secure_url, []), (named.url, ["-ZZ"]), (named.local_url, [])):
        found = ldapsearch(url, *options, "-Y", "DIGEST-MD5", "-U", "boss", "-w", named.password,
                           environment=trusting)
        assert is_root(found), found.stderr
        assert b"security layer installed" not in found.stderr, found.stderr


# ---- Kerberos

@pytest.fixture(scope="module")
def realm(tmp_path_factory):
    made = kerberos.Realm(tmp_path_factory.mktemp("kerberos") / "realm")
    yield made
    made.stop()


def by_ticket(server, ticket, *more):
    return ldapsearch("ldap://localhost:%d" % server.port, "-Q", "-Y", "GSSAPI", *more,
                      environment=ticket)


@pytest.fixture
def kerberized(instance, realm):
    instance.config.set(clients.BASE, "orv-slapdMaxUnauthenticatedMessageSize", str(1 << 20))
    with_kerberos(instance, realm.keytab("ldap/localhost"))
    return instance.start(environment=realm.environment)


def test_ldapsearch_binds_by_kerberos(kerberized, realm):
    assert announced(clients.connect(kerberized)) == ["GSSAPI"]
    found = by_ticket(kerberized, realm.ticket("admin"))
    assert is_root(found), found.stderr
    assert is_refused(by_ticket(kerberized, realm.ticket("stranger")))
    assert is_refused(by_ticket(kerberized, realm.ticket("admin/other")))
    kerberized.stop()
    log = kerberized.access_log.read_text()
    assert 'mechanism="GSSAPI" name="admin@EXAMPLE.COM" as="CN=ROOT" result=0' in log
    assert 'mechanism="GSSAPI" name="stranger@EXAMPLE.COM" result=49' in log


@pytest.mark.parametrize("name", ["orv-kerberosName=ADMIN@example.com", "ORV-KN=Admin@Example.COM",
                                  "orv-kn = admin@EXAMPLE.COM"])
def test_kerberos_identity_is_found_in_any_letter_case_and_with_either_prefix(instance, realm, name):
    with_kerberos(instance, realm.keytab("ldap/localhost"), name)
    instance.start(environment=realm.environment)
    assert is_root(by_ticket(instance, realm.ticket("admin")))


def test_members_bind_by_kerberos_without_a_password(kerberized, realm):
    root = clients.bind(kerberized)
    dn, attributes = member("alice", KrbAdminDN="orv-kn=alice/admin@EXAMPLE.COM",
                            roles=["ServerConfigGroupMember"])
    del attributes["orv-slapdAdminPW"]
    assert add(root, dn, attributes) == 0
    found = by_ticket(kerberized, realm.ticket("alice/admin"))
    assert found.returncode == 0, found.stderr
    assert is_refused(by_ticket(kerberized, realm.ticket("alice")))


def test_members_decide_neither_whose_keys_are_believed_nor_which_mechanisms_there_are(root, server):
    every_role = ["AuditAdmin", "ReplicationAdmin", "SchemaAdmin", "ServerConfigGroupMember"]
    assert add(root, *member("alice", roles=every_role)) == 0
    alice = clients.bind(server, "cn=alice", PASSWORD)
    for name, value in (("orv-slapdKrbKeytab", "/tmp/x"), ("orv-slapdSaslMechanisms", "EXTERNAL")):
        assert modify(alice, GROUP, replaced(name, value)) == 50
        assert modify(alice, clients.BASE, replaced(name, value)) != 0
        assert modify(root, GROUP, replaced(name, value)) == 0
    assert modify(root, GROUP, replaced("orv-slapdKrbKeytab", "relative")) == 21


def test_realm_of_the_principal_counts(instance, realm):
    with_kerberos(instance, realm.keytab("ldap/localhost"), "orv-kn=admin@ELSEWHERE.ORG")
    instance.start(environment=realm.environment)
    assert is_refused(by_ticket(instance, realm.ticket("admin")))


def test_nobody_acts_as_anybody_else_by_kerberos(kerberized, realm):
    ticket = realm.ticket("admin")
    for allowed in ("u:admin@EXAMPLE.COM", "dn:cn=root"):
        assert is_root(by_ticket(kerberized, ticket, "-X", allowed)), allowed
    for refused in ("u:admin", "u:alice@EXAMPLE.COM", "dn:cn=alice", "admin"):
        assert is_refused(by_ticket(kerberized, ticket, "-X", refused)), refused


@pytest.mark.parametrize("strength", ["maxssf=0", "maxssf=1", "minssf=112"])
def test_layers_of_kerberos(kerberized, realm, strength):
    root = clients.bind(kerberized)
    for number in range(20):
        assert add(root, "cn=e%d,cn=schemas,cn=configuration" % number,
                   {"objectClass": ["top", "container"], "cn": ["e%d" % number],
                    "description": ["x" * 50000]}) == 0
    found = subprocess.run(
        ["ldapsearch", "-LLL", "-Q", "-N", "-o", "ldif-wrap=no", "-Y", "GSSAPI", "-O", strength,
         "-H", "ldap://localhost:%d" % kerberized.port, "-b", "cn=schemas,cn=configuration"],
        stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE, check=False,
        env=realm.ticket("admin"))
    assert found.returncode == 0, found.stderr
    assert found.stdout.count(b"x" * 50000 + b"\n") == 20


def test_keytab_that_cannot_be_used_is_told_and_gssapi_not_announced(instance, realm, tmp_path):
    open_to_all = realm.keytab("ldap/localhost", "open.keytab")
    open_to_all.chmod(0o644)
    of_another = realm.keytab("host/localhost", "other.keytab")
    (realm.folder / "open").mkdir()
    replaceable = realm.keytab("ldap/localhost", "open/own.keytab")
    replaceable.parent.chmod(0o777)
    rubbish = tmp_path / "rubbish"
    rubbish.write_bytes(b"not a keytab")
    rubbish.chmod(0o600)
    for keytab, cause in ((open_to_all, "others may read"), (of_another, "no key of a service"),
                          (rubbish, "no key of a service"), (tmp_path / "none", "No such file"),
                          (tmp_path, "not a regular file"),
                          (replaceable, "this folder can be written by others")):
        with_keytab = instance.config.path.read_text()
        with_kerberos(instance, keytab)
        instance.start(environment=realm.environment)
        assert announced(clients.connect(instance)) == []
        instance.stop()
        assert any("GSSAPI is not offered" in line and cause in line
                   for line in instance.stderr.text().splitlines()), cause
        instance.config.path.write_text(with_keytab)


def test_keytab_is_taken_over_by_hangup(instance, realm):
    with_kerberos(instance, realm.folder / "later.keytab")
    instance.start(environment=realm.environment)
    assert announced(clients.connect(instance)) == []
    realm.keytab("ldap/localhost", "later.keytab")
    reload(instance)
    assert announced(clients.connect(instance)) == ["GSSAPI"]
    assert is_root(by_ticket(instance, realm.ticket("admin")))


def test_kerberos_works_without_the_name_service_that_its_settings_ask(instance, realm, tmp_path):
    """The serving process reaches none; at the start it may."""
    settings = tmp_path / "krb5.conf"
    settings.write_text((realm.folder / "krb5.conf").read_text()
                        .replace("dns_canonicalize_hostname = false", "dns_canonicalize_hostname = true")
                        .replace("rdns = false", "rdns = true")
                        .replace("dns_lookup_realm = false", "dns_lookup_realm = true"))
    with_kerberos(instance, realm.folder / "afterwards.keytab")
    instance.start(environment={**realm.environment, "KRB5_CONFIG": str(settings)})
    assert announced(clients.connect(instance)) == []
    realm.keytab("ldap/localhost", "afterwards.keytab")
    reload(instance)
    assert is_root(by_ticket(instance, realm.ticket("admin")))


def test_connection_ends_when_the_kerberos_identity_is_taken_away(kerberized, realm, monkeypatch):
    for name, value in realm.ticket("admin").items():
        monkeypatch.setenv(name, value)
    client = ldap.initialize("ldap://localhost:%d" % kerberized.port)
    client.set_option(ldap.OPT_X_SASL_NOCANON, ldap.OPT_ON)
    client.sasl_gssapi_bind_s()
    assert "orv-slapdAdminPW" in clients.read(client, clients.BASE)
    root = clients.bind(kerberized)
    assert modify(root, KERBEROS, replaced("orv-slapdKrbAdminDN", "orv-kn=new@EXAMPLE.COM")) == 0
    with pytest.raises(ldap.LDAPError):
        clients.read(client, clients.BASE)
    assert is_refused(by_ticket(kerberized, realm.ticket("admin")))
    assert is_root(by_ticket(kerberized, realm.ticket("new")))


def test_nothing_of_the_library_is_taken_from_the_environment(instance, tmp_path):
    (tmp_path / "orvd.conf").write_text("mech_list: PLAIN\nreauth_timeout: 100\n")
    text = instance.config.path.read_text()
    instance.config.path.write_text(
        text.replace("\ncn: Digest\n", "\ncn: Digest\norv-slapdDigestAdminUser: boss\n"))
    instance.start(environment={"SASL_PATH": str(tmp_path), "SASL_CONF_PATH": str(tmp_path)})
    assert announced(clients.connect(instance)) == ["SCRAM-SHA-256", "DIGEST-MD5"]
    assert is_root(by_password(instance.url, "DIGEST-MD5", "boss", instance.password))


# ---- hostile clients

def test_no_log_is_written_into_the_keytab(kerberized, realm):
    keytab = realm.folder / "ldap_localhost.keytab"
    before = keytab.read_bytes()
    root = clients.bind(kerberized)
    assert modify(root, "cn=access,cn=log management,cn=configuration",
                  replaced("orv-slapdLog", str(keytab))) in (0, 53)
    reload(kerberized)
    clients.bind(kerberized)
    assert keytab.read_bytes() == before


@pytest.mark.parametrize("mechanism", BY_PASSWORD + ["GSSAPI"])
def test_rubbish_is_refused_and_the_server_serves_on(kerberized, mechanism):
    root = clients.bind(kerberized)
    assert modify(root, DIGEST, replaced("orv-slapdDigestAdminUser", "boss")) == 0
    for text in (None, b"", b"\0", b"n,,", b"n,,n=boss,r=", b"n,,n=boss,r=x" * 9000, b"=" * 65537,
                 b'username="boss",nonce="x"', b"\x60\x82\xff\xff", bytes(range(256)) * 16):
        for answer in (None, b"", b"c=biws,r=x,p=AAAA", b'username="boss"' * 300, b"\xff" * 70000):
            with wire.Wire(kerberized) as client:
                if sasl_step(client, mechanism, text) == 14:
                    assert sasl_step(client, mechanism, answer) in (14, 49)
    assert is_root(by_password(kerberized.url, "DIGEST-MD5", "boss", kerberized.password))
