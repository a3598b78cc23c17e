"""TLS, the Unix socket and EXTERNAL, with clients that nobody here wrote, and with raw sockets."""

import os
import signal
import socket
import ssl
import subprocess
import time

import ldap
import ldap.sasl
import pytest

from orv_e2e import clients, wire
from orv_e2e.certificates import Authority
from orv_e2e.changes import GROUP, PASSWORD, add, member
from orv_e2e.config_file import record
from orv_e2e.programs import DEADLINE

START_TLS = "1.3.6.1.4.1.1466.20037"
ROLES = ["AuditAdmin", "ReplicationAdmin", "SchemaAdmin", "ServerConfigGroupMember"]


def run_search(url, *arguments, **variables):
    """Runs ldapsearch for the tree's base, with variables that name certificates to it."""
    environment = {name: value for name, value in os.environ.items() if name != "LDAPNOINIT"}
    environment.update({name: str(value) for name, value in variables.items()})
    return subprocess.run(
        ["ldapsearch", "-LLL", "-H", url, *arguments, "-b", "cn=configuration", "-s", "base",
         "orv-slapdAdminPW"], stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE,
        check=False, env=environment)


def login(instance):
    return ["-x", "-D", "cn=root", "-y", str(instance.directory / "admin.pw")]


def connect(instance, url=None, pair=None, authority=None):
    """A python3-ldap connection that checks the server's certificate, and may show one."""
    client = ldap.initialize(url or instance.secure_url)
    client.protocol_version = ldap.VERSION3
    client.set_option(ldap.OPT_NETWORK_TIMEOUT, DEADLINE)
    client.set_option(ldap.OPT_TIMEOUT, DEADLINE)
    client.set_option(ldap.OPT_X_TLS_CACERTFILE, str(authority or instance.certificate))
    client.set_option(ldap.OPT_X_TLS_REQUIRE_CERT, ldap.OPT_X_TLS_DEMAND)
    if pair:
        client.set_option(ldap.OPT_X_TLS_CERTFILE, str(pair[0]))
        client.set_option(ldap.OPT_X_TLS_KEYFILE, str(pair[1]))
    client.set_option(ldap.OPT_X_TLS_NEWCTX, 0)
    return client


def bind_external(client, authorization_id=""):
    client.sasl_non_interactive_bind_s("EXTERNAL", authz_id=authorization_id)


def sees_passwords(client):
    return "orv-slapdAdminPW" in clients.read(client, clients.BASE)


def modify(client, dn, *changes):
    client.modify_s(dn, [(how, name, None if values is None else [v.encode() for v in values])
                         for how, name, values in changes])


def set_value(client, dn, name, *values):
    modify(client, dn, (ldap.MOD_REPLACE, name, list(values)))


def tls_socket(instance, port=None, **limits):
    """A raw TLS connection that trusts everybody."""
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
    context.check_hostname = False
    context.verify_mode = ssl.CERT_NONE
    context.set_ciphers("ALL:@SECLEVEL=0")
    for name, value in limits.items():
        setattr(context, name, value)
    plain = socket.create_connection((instance.host, port or instance.secure_port), DEADLINE)
    return context.wrap_socket(plain)


def assert_nothing_but_an_alert(connection):
    """The server ends the connection, perhaps with an alert of TLS."""
    try:
        left = connection.recv(1 << 16)
    except ConnectionResetError:
        left = b""
    assert left == b"" or left[0] == 21


def fill(instance, entries, size):
    """Adds entries of a size to the tree."""
    instance.config.append(b"\n".join(
        record("cn=e%d,cn=schemas,cn=configuration" % number,
               [("objectClass", ["top", "container"]), ("cn", "e%d" % number),
                ("description", "x" * size)]) for number in range(entries)))


def presented(instance):
    """What the server shows to a new connection, in DER."""
    with tls_socket(instance) as connection:
        return connection.getpeercert(binary_form=True)


# ---- at once after the first start

def test_ldapsearch_with_start_tls(server):
    found = run_search(server.url, "-ZZ", *login(server),
                       LDAPTLS_CACERT=server.certificate)
    assert found.returncode == 0, found.stderr
    assert b"orv-slapdAdminPW" in found.stdout


def test_ldapsearch_over_the_port_for_tls(server):
    found = run_search(server.secure_url, *login(server), LDAPTLS_CACERT=server.certificate)
    assert found.returncode == 0, found.stderr
    assert b"orv-slapdAdminPW" in found.stdout


def test_client_that_trusts_somebody_else_gives_up(server, tmp_path):
    other = Authority(tmp_path / "other").certificate
    for url, options in ((server.secure_url, []), (server.url, ["-ZZ"])):
        found = run_search(url, *options, *login(server), LDAPTLS_CACERT=other)
        assert found.returncode != 0


def test_python_ldap_completes_a_tour_under_start_tls(server):
    client = connect(server, server.url)
    client.start_tls_s()
    client.simple_bind_s("cn=root", server.password)
    assert sees_passwords(client)
    assert add(client, *member("alice")) == 0
    set_value(client, clients.BASE, "orv-slapdSizeLimit", "7")
    client.delete_s("cn=alice," + GROUP)
    with pytest.raises(ldap.NO_SUCH_OBJECT):
        client.delete_s("cn=alice," + GROUP)
    client.unbind_s()


def test_large_tree_arrives_whole_through_tls(instance):
    fill(instance, 300, 20000)
    instance.start()
    client = connect(instance)
    client.simple_bind_s("cn=root", instance.password)
    assert len(clients.search(client, "cn=schemas,cn=configuration")) > 300


def test_root_dse_announces_what_the_connection_can_use(server):
    def offered(client, name):
        return client.search_s("", ldap.SCOPE_BASE, attrlist=[name])[0][1].get(name, [])

    clear, secure = clients.connect(server), connect(server)
    local = ldap.initialize(server.local_url)
    assert START_TLS.encode() in offered(clear, "supportedExtension")
    assert START_TLS.encode() not in offered(secure, "supportedExtension")
    assert b"EXTERNAL" not in offered(clear, "supportedSASLMechanisms")
    assert b"EXTERNAL" not in offered(secure, "supportedSASLMechanisms")
    assert b"EXTERNAL" in offered(local, "supportedSASLMechanisms")


def test_access_log_names_version_cipher_and_mechanism(server):
    connect(server).simple_bind_s("cn=root", server.password)
    bind_external(ldap.initialize(server.local_url))
    server.stop()
    text = server.access_log.read_text()
    assert "TLS version=TLSv1.3 cipher=TLS_" in text
    assert 'BIND dn="cn=root" simple as="CN=ROOT" result=0' in text
    assert 'BIND dn="" sasl mechanism="EXTERNAL" as="CN=ROOT" result=0' in text
    assert "from=local uid=%d" % os.geteuid() in text


# ---- the Unix socket

def test_ldapsearch_as_the_servers_user_is_the_primary_administrator(server):
    found = run_search(server.local_url, "-Q", "-Y", "EXTERNAL")
    assert found.returncode == 0, found.stderr
    assert b"orv-slapdAdminPW" in found.stdout


@pytest.mark.skipif(os.geteuid() != 0, reason="only root can become somebody else")
def test_other_users_are_nobody_over_the_socket(server):
    path = server.directory / "ldapi"
    assert path.stat().st_mode & 0o777 == 0o600
    path.chmod(0o777)
    for folder in [server.directory, *list(server.directory.parents)[:-2]]:
        folder.chmod(folder.stat().st_mode | 0o011)
    found = subprocess.run(
        ["setpriv", "--reuid", "65534", "--regid", "65534", "--clear-groups", "ldapsearch", "-LLL",
         "-Q", "-Y", "EXTERNAL", "-H", server.local_url, "-b", "cn=configuration"],
        stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=DEADLINE, check=False)
    assert found.returncode != 0
    assert b"orv-slapdAdminPW" not in found.stdout
    server.stop()
    assert "from=local uid=65534" in server.access_log.read_text()


def test_administrator_who_is_locked_out_gets_in_over_the_socket(server, root):
    set_value(root, "cn=pwdpolicy admin,cn=configuration", "pwdMaxFailure", "2")
    for _ in range(3):
        with pytest.raises(ldap.INVALID_CREDENTIALS):
            clients.bind(server, password="wrong")
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        clients.bind(server)
    local = ldap.initialize(server.local_url)
    bind_external(local)
    assert sees_passwords(local)


def test_socket_of_a_server_that_was_killed_is_replaced(server):
    server.kill()
    assert (server.directory / "ldapi").exists()
    server.start()
    bind_external(ldap.initialize(server.local_url))
    server.stop()
    assert not (server.directory / "ldapi").exists()


# ---- certificates of clients

@pytest.fixture(name="trusting")
def trusting_fixture(server, root, tmp_path):
    """A server that knows an authority, and the member alice with a certificate."""
    authority = Authority(tmp_path / "ca")
    pair = authority.pair("alice")
    assert add(root, *member("alice", roles=ROLES)) == 0
    modify(root, GROUP,
           (ldap.MOD_ADD, "orv-slapdTlsCaFile", [str(authority.certificate)]),
           (ldap.MOD_REPLACE, "orv-slapdTlsClientCertificate", ["optional"]),
           (ldap.MOD_ADD, "orv-slapdCertificateMap", ["cn=alice, o=Orv Tests => cn=alice"]))
    return server, root, authority, pair


def test_mapped_certificate_binds_as_its_identity(trusting):
    server, _, _, pair = trusting
    client = connect(server, pair=pair)
    bind_external(client)
    assert not sees_passwords(client)
    assert clients.search(client)
    set_value(client, clients.BASE, "orv-slapdSizeLimit", "1000")
    bind_external(client, "dn:cn=alice")
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        bind_external(client, "dn:cn=root")
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        clients.search(client)


def test_mapped_certificate_binds_after_start_tls(trusting):
    server, _, _, pair = trusting
    client = connect(server, server.url, pair)
    client.start_tls_s()
    bind_external(client)
    assert clients.search(client)


def test_certificate_that_is_mapped_to_nobody_is_nobody(trusting):
    server, _, authority, _ = trusting
    for subject in ("/O=Orv Tests/CN=bob", "/O=Orv Tests/CN=alice/CN=x", "/CN=alice",
                    "/O=Orv Tests\\, CN=alice", "/O=Orv Tests/CN=alice\\, O=Orv Tests"):
        client = connect(server, pair=authority.pair("stranger", subject))
        with pytest.raises(ldap.INVALID_CREDENTIALS):
            bind_external(client)


def test_certificate_of_another_authority_gets_no_connection(trusting, tmp_path):
    server, _, _, _ = trusting
    pair = Authority(tmp_path / "other").pair("alice")
    with pytest.raises(ldap.LDAPError) as refusal:
        client = connect(server, pair=pair)
        bind_external(client)
        clients.search(client)
    assert isinstance(refusal.value, (ldap.SERVER_DOWN, ldap.CONNECT_ERROR, ldap.LDAPError))
    server.stop()
    assert "TLS handshake failed" in server.access_log.read_text()
    assert 'as="CN=ALICE"' not in server.access_log.read_text()


def test_connection_ends_when_its_map_is_taken_away(trusting):
    server, root, _, pair = trusting
    client = connect(server, pair=pair)
    bind_external(client)
    modify(root, GROUP, (ldap.MOD_DELETE, "orv-slapdCertificateMap", None))
    with pytest.raises((ldap.SERVER_DOWN, ldap.STRONG_AUTH_REQUIRED, ldap.INSUFFICIENT_ACCESS,
                        ldap.UNAVAILABLE)):
        clients.search(client)
    again = connect(server, pair=pair)
    with pytest.raises(ldap.STRONG_AUTH_NOT_SUPPORTED):  # for want of any other map
        bind_external(again)


def assert_ended(client):
    with pytest.raises((ldap.SERVER_DOWN, ldap.STRONG_AUTH_REQUIRED, ldap.INSUFFICIENT_ACCESS,
                        ldap.UNAVAILABLE)):
        clients.search(client)


@pytest.mark.parametrize("how", ["a setting", "another file", "a hangup"])
def test_connection_ends_when_its_authority_is_taken_away(trusting, tmp_path, how):
    server, root, authority, pair = trusting
    client = connect(server, pair=pair)
    bind_external(client)
    other = Authority(tmp_path / "other")
    if how == "a setting":
        set_value(root, GROUP, "orv-slapdTlsClientCertificate", "none")
    elif how == "another file":
        set_value(root, GROUP, "orv-slapdTlsCaFile", str(other.certificate))
    else:
        other.certificate.rename(authority.certificate)
        server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "no longer good" in line and ": closed 127." in line)
    assert_ended(client)
    server.stop()
    assert "DISCONNECT result=8 reason=" in server.access_log.read_text()


def test_revoked_certificate_is_refused_and_its_connection_ends(trusting):
    server, root, authority, pair = trusting
    bob = authority.pair("bob")
    modify(root, GROUP,
           (ldap.MOD_ADD, "orv-slapdTlsCrlFile", [str(authority.revocations())]),
           (ldap.MOD_ADD, "orv-slapdCertificateMap", ["cn=bob, o=Orv Tests => cn=root"]))
    alice, other = connect(server, pair=pair), connect(server, pair=bob)
    bind_external(alice)
    bind_external(other)
    authority.revocations(pair[0])
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "(certificate revoked): closed" in line)
    assert_ended(alice)
    assert sees_passwords(other)
    with pytest.raises(ldap.LDAPError):
        bind_external(connect(server, pair=pair))
    bind_external(connect(server, pair=bob))


def test_list_of_revoked_certificates_that_is_none_is_refused(trusting, tmp_path):
    _, root, _, pair = trusting
    for path in (pair[0], tmp_path / "nothing"):
        with pytest.raises(ldap.UNWILLING_TO_PERFORM) as refusal:
            set_value(root, GROUP, "orv-slapdTlsCrlFile", str(path))
        assert str(path) in refusal.value.args[0]["info"]


def test_required_certificate_keeps_everybody_else_out(trusting):
    server, root, _, pair = trusting
    set_value(root, GROUP, "orv-slapdTlsClientCertificate", "required")
    bind_external(connect(server, pair=pair))
    with pytest.raises(ldap.LDAPError):
        client = connect(server)
        client.simple_bind_s("cn=root", server.password)


# ---- who may change what is trusted

SETTINGS = [("orv-slapdTlsCertificateFile", "/tmp/x"), ("orv-slapdTlsKeyFile", "/tmp/x"),
            ("orv-slapdTlsCaFile", "/tmp/x"), ("orv-slapdTlsCrlFile", "/tmp/x"),
            ("orv-slapdTlsClientCertificate", "optional"),
            ("orv-slapdTlsMinimumVersion", "1.2"), ("orv-slapdTlsForPasswords", "FALSE"),
            ("orv-slapdTlsForLocalPasswords", "FALSE"),
            ("orv-slapdCertificateMap", "cn=x => cn=root")]


@pytest.mark.parametrize("name,value", SETTINGS)
def test_members_cannot_change_what_the_server_trusts(server, root, name, value):
    assert add(root, *member("alice", roles=ROLES)) == 0
    alice = clients.bind(server, "cn=alice", PASSWORD)
    with pytest.raises(ldap.INSUFFICIENT_ACCESS):
        set_value(alice, GROUP, name, value)
    for dn in (clients.BASE, "cn=schemas,cn=configuration", "cn=alice," + GROUP):
        with pytest.raises(ldap.LDAPError) as refusal:
            modify(alice, dn, (ldap.MOD_ADD, "objectClass", ["orv-slapdAdminGroupSettings"]),
                   (ldap.MOD_ADD, name, [value]))
        assert refusal.value.args[0]["result"] in (50, 53)


NUMBERS = "2.25.83817390626969804497818767862655265745."
MAP_TO_ROOT = "cn=x => cn=root"


def test_members_cannot_change_the_map_in_any_spelling(server, root):
    assert add(root, *member("alice", roles=ROLES)) == 0
    alice = clients.bind(server, "cn=alice", PASSWORD)
    before = clients.read(root, GROUP)
    for dn in (GROUP, "CN = AdminGroup , CN = Configuration", "cn=\\41dmingroup,cn=configuration",
               "2.5.4.3=#0C0A41646D696E47726F7570,cn=configuration",
               "commonname=admingroup,cn=configuration"):
        for name in ("ORV-SLAPDCERTIFICATEMAP", NUMBERS + "1.72", "orv-slapdCertificateMap;lang-en",
                     NUMBERS + "1.72;x-a", " orv-slapdCertificateMap", "orv-slapdCertificateMap "):
            for how in (ldap.MOD_ADD, ldap.MOD_REPLACE):
                with pytest.raises((ldap.INSUFFICIENT_ACCESS, ldap.PROTOCOL_ERROR,
                                    ldap.UNDEFINED_TYPE, ldap.UNWILLING_TO_PERFORM)):
                    modify(alice, dn, (how, name, [MAP_TO_ROOT]))
    assert clients.read(root, GROUP) == before


def test_members_cannot_put_what_is_trusted_into_other_entries(server, root):
    assert add(root, *member("alice", roles=ROLES)) == 0
    alice = clients.bind(server, "cn=alice", PASSWORD)
    for name in ("orv-slapdAdminGroupSettings", "ORV-SLAPDADMINGROUPSETTINGS", NUMBERS + "2.17"):
        for parent in (clients.BASE, GROUP, "cn=schemas,cn=configuration"):
            assert add(alice, "cn=new," + parent, {
                "objectClass": ["top", "container", name], "cn": ["new"],
                "orv-slapdCertificateMap": [MAP_TO_ROOT]}) in (50, 53)
    # Not by putting an entry of their own in its place either.
    before = clients.read(root, GROUP)
    with pytest.raises((ldap.INSUFFICIENT_ACCESS, ldap.NOT_ALLOWED_ON_NONLEAF)):
        alice.delete_s(GROUP)
    assert clients.read(root, GROUP) == before


@pytest.mark.parametrize("name,value", [
    ("orv-slapdTlsMinimumVersion", "1.1"), ("orv-slapdTlsClientCertificate", "maybe"),
    ("orv-slapdTlsCaFile", "relative"), ("orv-slapdCertificateMap", "nonsense"),
    ("orv-slapdTlsForPasswords", "perhaps")])
def test_values_that_the_server_would_not_start_with_are_refused(root, name, value):
    before = clients.read(root, GROUP)
    with pytest.raises((ldap.CONSTRAINT_VIOLATION, ldap.INVALID_SYNTAX)):
        set_value(root, GROUP, name, value)
    assert clients.read(root, GROUP) == before


@pytest.mark.parametrize("name", ["orv-slapdTlsCertificateFile", "orv-slapdTlsKeyFile"])
def test_files_that_the_server_would_not_start_with_are_refused(root, tmp_path, name):
    before = clients.read(root, GROUP)
    rubbish = tmp_path / "rubbish"
    rubbish.write_text("no certificate")
    rubbish.chmod(0o600)
    for path in (rubbish, tmp_path / "nothing"):
        with pytest.raises(ldap.UNWILLING_TO_PERFORM) as refusal:
            set_value(root, GROUP, name, str(path))
        assert str(path) in refusal.value.args[0]["info"]
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):  # nobody says who signs them
        set_value(root, GROUP, "orv-slapdTlsClientCertificate", "required")
    assert clients.read(root, GROUP) == before


def test_group_is_not_added_with_files_that_the_server_would_not_start_with(server, root, tmp_path):
    group = {name: [value.decode() for value in values]
             for name, values in clients.read(root, GROUP).items()
             if not name.startswith("orv-slapdTls")}
    certificate, key = Authority(tmp_path / "ca").pair("renewed")
    root.delete_s(GROUP)
    before = server.config.read()
    for settings in ({"orv-slapdTlsCertificateFile": [str(tmp_path / "nothing")]},
                     {"ORV-SLAPDTLSCERTIFICATEFILE": [str(certificate)]},  # without its key
                     {"orv-slapdTlsCertificateFile": [str(certificate)],
                      "orv-slapdTlsKeyFile": [str(key)],
                      "orv-slapdTlsClientCertificate": ["required"]}):  # nobody says who signs them
        assert add(root, "CN = AdminGroup, cn=configuration", {**group, **settings}) == 53
        assert server.config.read() == before
    assert add(root, GROUP, {**group, "orv-slapdTlsCertificateFile": [str(certificate)],
                             "orv-slapdTlsKeyFile": [str(key)]}) == 0
    server.stop()
    server.start()
    presented(server)


def test_certificate_and_key_change_in_one_request(server, root, tmp_path):
    certificate, key = Authority(tmp_path / "ca").pair("renewed")
    with pytest.raises(ldap.UNWILLING_TO_PERFORM):
        set_value(root, GROUP, "orv-slapdTlsKeyFile", str(key))
    first = presented(server)
    modify(root, GROUP, (ldap.MOD_REPLACE, "orv-slapdTlsCertificateFile", [str(certificate)]),
           (ldap.MOD_REPLACE, "orv-slapdTlsKeyFile", [str(key)]))
    assert presented(server) != first


# ---- a new certificate

def test_hangup_takes_the_new_certificate_and_keeps_old_connections(server, tmp_path):
    authority = Authority(tmp_path / "ca")
    before = connect(server)
    before.simple_bind_s("cn=root", server.password)
    first = presented(server)
    certificate, key = authority.pair("renewed")
    key.rename(server.directory / "tls.key")
    certificate.rename(server.certificate)
    seen = len(server.stderr.lines())
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "settings taken over" in line, start=seen)
    server.stderr.wait_for(lambda line: "certificate for TLS: cn=renewed" in line, start=seen)
    assert presented(server) != first
    assert sees_passwords(before)
    connect(server, authority=authority.certificate).simple_bind_s("cn=root", server.password)


def test_hangup_with_a_bad_certificate_keeps_the_old_and_says_so(server):
    first = presented(server)
    good = server.certificate.read_bytes()
    for bad in (b"", b"nonsense", good[:100]):
        server.certificate.write_bytes(bad)
        seen = len(server.stderr.lines())
        server.process.send_signal(signal.SIGHUP)
        server.stderr.wait_for(
            lambda line: "TLS stays as it was: %s" % server.certificate in line and
            "before the next start" in line, start=seen)
        assert presented(server) == first
    key = server.directory / "tls.key"
    server.certificate.write_bytes(good)
    key.chmod(0o644)
    seen = len(server.stderr.lines())
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "others may read the private key" in line, start=seen)
    assert presented(server) == first


def test_server_does_not_start_with_a_key_of_another_certificate(instance, tmp_path):
    _, key = Authority(tmp_path / "ca").pair("other")
    key.rename(instance.directory / "tls.key")
    exit_code, stderr = instance.start_refused()
    assert exit_code == 1
    assert "tls.key: " in stderr
    checked = subprocess.run(instance.command("--check"), stdout=subprocess.PIPE,
                             stderr=subprocess.PIPE, timeout=DEADLINE, check=False)
    assert checked.returncode == 1
    assert b"tls.key: " in checked.stderr


def test_certificate_that_has_expired_is_used_but_told_of(instance, tmp_path):
    certificate, key = Authority(tmp_path / "ca").pair("old", days=-1)
    key.rename(instance.directory / "tls.key")
    certificate.rename(instance.certificate)
    instance.start()
    instance.stderr.wait_for(lambda line: "has expired" in line)


# ---- passwords in clear

def test_passwords_in_clear_are_refused_where_the_settings_say_so(server, root):
    set_value(root, GROUP, "orv-slapdTlsForLocalPasswords", "TRUE")
    for password in (server.password, "wrong"):
        with pytest.raises(ldap.CONFIDENTIALITY_REQUIRED):
            clients.bind(server, password=password)
    with pytest.raises(ldap.CONFIDENTIALITY_REQUIRED):
        ldap.initialize(server.local_url).simple_bind_s("cn=root", server.password)
    connect(server).simple_bind_s("cn=root", server.password)
    bind_external(ldap.initialize(server.local_url))
    clients.connect(server).simple_bind_s("", "")


# ---- raw sockets

def test_what_is_sent_behind_start_tls_is_never_executed(server, root):
    delete = wire.message(3, wire.tlv(0x4A, b"cn=digest,cn=configuration"))
    request = wire.message(2, wire.tlv(0x77, wire.octets(START_TLS, 0x80)))
    with wire.bound(server) as client:
        client.send(request + delete)
        answers = client.answers_until_closed()
        assert [answer.is_notice for answer in answers] == [True]
    with wire.bound(server) as client:
        client.send(request)
        assert client.answer().code == 0
        client.send(delete)
        assert_nothing_but_an_alert(client.socket)
    assert clients.read(root, "cn=digest,cn=configuration")


@pytest.mark.parametrize("version", [ssl.TLSVersion.TLSv1, ssl.TLSVersion.TLSv1_1])
def test_old_versions_are_refused(server, version):
    with pytest.raises((ssl.SSLError, ConnectionError)):
        tls_socket(server, minimum_version=version, maximum_version=version)


@pytest.mark.parametrize("version", ["TLSv1.2", "TLSv1.3"])
def test_both_versions_are_spoken(server, version):
    number = getattr(ssl.TLSVersion, version.replace(".", "_"))
    with tls_socket(server, minimum_version=number, maximum_version=number) as connection:
        assert connection.version() == version


def test_clear_requests_at_the_port_for_tls_are_not_answered(server):
    for data in (wire.bind_request(1, "cn=root", server.password), b"GET / HTTP/1.0\r\n\r\n"):
        with socket.create_connection((server.host, server.secure_port), DEADLINE) as client:
            client.sendall(data)
            assert_nothing_but_an_alert(client)
    server.stop()
    assert "BIND" not in server.access_log.read_text()


def test_slow_handshakes_are_cut_off_while_an_administrator_is_served(instance):
    instance.config.set(clients.BASE, "orv-slapdTlsHandshakeTimeOut", "1")
    instance.start()
    silent = [socket.create_connection((instance.host, instance.secure_port), DEADLINE)
              for _ in range(100)]
    for connection in silent[::2]:
        connection.sendall(b"\x16\x03\x01\x02\x00\x01\x00")
    client = connect(instance)
    client.simple_bind_s("cn=root", instance.password)
    started = time.monotonic()
    assert sees_passwords(client)
    assert time.monotonic() - started < DEADLINE / 4
    for connection in silent:
        connection.settimeout(DEADLINE)
        try:
            assert connection.recv(100) == b""
        except ConnectionResetError:
            pass
        connection.close()
    assert sees_passwords(client)


def test_handshake_that_is_cut_anywhere_harms_nobody(server):
    recorded = _client_hello()
    for end in range(0, len(recorded), 7):
        with socket.create_connection((server.host, server.secure_port), DEADLINE) as client:
            client.sendall(recorded[:end])
    assert presented(server)


def _client_hello():
    """The first bytes that a TLS client sends."""
    incoming, outgoing = ssl.MemoryBIO(), ssl.MemoryBIO()
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
    client = context.wrap_bio(incoming, outgoing, server_hostname="localhost")
    with pytest.raises(ssl.SSLWantReadError):
        client.do_handshake()
    return outgoing.read()


def test_client_that_leaves_without_a_word_in_the_middle_of_an_answer_harms_nobody(server):
    for _ in range(20):
        connection = tls_socket(server)
        connection.sendall(wire.bind_request(1, "cn=root", server.password))
        connection.recv(100)
        connection.sendall(wire.search_request(2, scope=2, attributes=()))
        connection.recv(10)
        # Reset, without a word of TLS.
        connection.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, b"\1\0\0\0\0\0\0\0")
        os.close(connection.detach())
    client = connect(server)
    client.simple_bind_s("cn=root", server.password)
    assert sees_passwords(client)


def test_reader_that_does_not_read_is_cut_off_inside_tls(instance):
    instance.config.set(clients.BASE, "orv-slapdWriteTimeOut", "1")
    fill(instance, 200, 100000)
    instance.start()
    stuck = tls_socket(instance)
    stuck.sendall(wire.bind_request(1, "cn=root", instance.password))
    stuck.recv(100)
    stuck.sendall(wire.search_request(2, scope=2, attributes=()))
    limit = time.monotonic() + DEADLINE
    while "does not read its answers" not in instance.access_log.read_text():
        assert time.monotonic() < limit, "the reader was not cut off"
        client = connect(instance)
        client.simple_bind_s("cn=root", instance.password)
        assert sees_passwords(client)
        client.unbind_s()
    stuck.close()


# ---- limits

def test_connections_on_which_nobody_is_bound_are_limited(instance):
    instance.config.set(clients.BASE, "orv-slapdMaxUnauthenticatedConnections", "3")
    instance.start()
    held = [wire.Wire(instance) for _ in range(3)]
    for number, connection in enumerate(held):
        assert connection.search(1, base="")[0] == 0, number
    with wire.Wire(instance) as beyond:
        assert beyond.answer().is_notice
        assert beyond.answer() is None
    instance.stderr.wait_for(lambda line: "nobody is bound" in line)
    bind_external(ldap.initialize(instance.local_url))
    assert held[0].bind("cn=root", instance.password) == 0
    with wire.Wire(instance) as again:
        assert again.search(1, base="")[0] == 0
    for connection in held:
        connection.close()
