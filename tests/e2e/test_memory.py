"""What is left in the daemon's memory after a bind, who may read it, and what a core dump would show."""

import os
import re
import signal
import socket
import ssl
import string
import subprocess
import sys
import time

import ldap
import ldap.sasl
import pytest

from orv_e2e import clients, kerberos, programs, wire


def mappings(pid):
    """The writable memory of the process: begin, end, and what the kernel does with it."""
    with open("/proc/%d/smaps" % pid, encoding="utf-8") as lines:
        for line in lines:
            found = re.match(r"([0-9a-f]+)-([0-9a-f]+) (rw)?", line)
            if found:
                begin, end, writable = found.groups()
            elif line.startswith("VmFlags:") and writable:
                yield int(begin, 16), int(end, 16), line.split()[1:]


def places_of(pid, wanted):
    """Of each piece of writable memory that contains the bytes, what the kernel does with it."""
    with open("/proc/%d/mem" % pid, "rb", buffering=0) as memory:
        for begin, end, flags in mappings(pid):
            memory.seek(begin)
            try:
                if wanted in memory.read(end - begin):
                    yield flags
            except OSError:  # pages that cannot be read
                continue


def copies_of(pid, wanted):
    """How often writable memory of the process contains the bytes."""
    copies = 0
    with open("/proc/%d/mem" % pid, "rb", buffering=0) as memory:
        for begin, end, _ in mappings(pid):
            memory.seek(begin)
            try:
                copies += memory.read(end - begin).count(wanted)
            except OSError:  # pages that cannot be read
                continue
    return copies


def holds(pid, wanted):
    """Whether writable memory of the process contains the bytes."""
    return next(places_of(pid, wanted), None) is not None


def without_rights():
    """Takes away what root may do more than others, so that users mean something."""
    return ["setpriv", "--bounding-set=-all", "--inh-caps=-all"] if os.geteuid() == 0 else []


def is_open_to_its_user(pid):
    """Whether another process of the same user may learn what the process's memory is."""
    read = subprocess.run([*without_rights(), "cat", "/proc/%d/maps" % pid], timeout=programs.DEADLINE,
                          stdout=subprocess.PIPE, stderr=subprocess.PIPE, check=False)
    return read.returncode == 0 and read.stdout != b""


def test_memory_is_closed_to_other_processes_of_the_same_user(instance):
    instance.start(wrapper=without_rights())
    assert not is_open_to_its_user(instance.process.pid)
    with subprocess.Popen([*without_rights(), "cat"], stdin=subprocess.PIPE,
                          stdout=subprocess.PIPE) as other:
        other.stdin.write(b"runs")
        other.stdin.flush()
        assert other.stdout.read(4) == b"runs"
        assert is_open_to_its_user(other.pid)  # what is closed is the daemon, not everything
        other.stdin.close()


def reader(request, tmp_path, fixture="server"):
    """The server of a test that reads its memory; None when it has been run as somebody who may."""
    if os.geteuid() != 0:
        # In a user namespace of its own this very test is root over the daemon that it starts.
        subprocess.run(["unshare", "--map-root-user", sys.executable, "-m", "pytest", "-q", "-p",
                        "no:cacheprovider", "--basetemp", tmp_path / "inside",
                        "%s::%s" % (__file__, request.node.name)], check=True,
                       timeout=2 * programs.DEADLINE)
        return None
    return request.getfixturevalue(fixture)


def middle_of(password):
    """Enough of it to give it away; the ends may be overwritten by the allocator."""
    quarter = len(password) // 4
    return password[quarter:-quarter]


def check_copies(pid, password, most):
    """That there are no more copies of a password: soon, as the answer is there before all of them
    are wiped."""
    until = time.monotonic() + programs.DEADLINE
    while copies_of(pid, middle_of(password)) > most:
        assert time.monotonic() < until, password


def remains(pid, password):
    """Whether enough of a password to give it away is in the process's memory."""
    return holds(pid, middle_of(password))


def test_passwords_sent_to_bind_are_wiped(request, tmp_path):
    server = reader(request, tmp_path)
    if server is None:
        return
    pid = server.process.pid
    short, long = b"Qx7#kRw2!vT", b"Jz5$" + b"pLm9&wQe" * 8
    with wire.Wire(server) as client:
        for password in (short, long):
            client.bind("cn=root", password.decode())
            client.bind("no dn", password.decode())
        client.bind("cn=somebody-to-be-found", "wrong")
        for password in (short, long):
            assert not remains(pid, password)
        assert holds(pid, server.config.path.name.encode())  # the search itself works


def test_passwords_that_never_became_whole_messages_are_wiped(request, tmp_path):
    """Of connections that ended meanwhile."""
    server = reader(request, tmp_path)
    if server is None:
        return
    pid = server.process.pid
    password = b"Wn8%" + b"tYv3!zAh" * 8
    bind = wire.bind_request(1, "cn=root", password)
    with wire.Wire(server) as client:
        client.send(bind[:-1])
        until = time.monotonic() + programs.DEADLINE
        while not remains(pid, password):  # it has been read
            assert time.monotonic() < until
    until = time.monotonic() + programs.DEADLINE
    while remains(pid, password):
        assert time.monotonic() < until


def test_passwords_that_prove_user_names_are_wiped(request, tmp_path):
    """The server opens what is sealed for the bind, and has nothing of it afterwards."""
    server = reader(request, tmp_path)
    if server is None:
        return
    password = "Qx7#kRw2!vTz4Lp9$bNm6"
    root = clients.bind(server)
    root.modify_s("cn=digest,cn=configuration",
                  [(ldap.MOD_REPLACE, "orv-slapdDigestAdminUser", [b"boss"])])
    root.modify_s(clients.BASE, [(ldap.MOD_REPLACE, "orv-slapdAdminPW", [password.encode()])])
    for mechanism in ("DIGEST-MD5", "SCRAM-SHA-256"):
        for given, expected in ((password, 0), ("wrong", 49)):
            found = subprocess.run(
                ["ldapwhoami", "-Q", "-Y", mechanism, "-U", "boss", "-w", given, "-H", server.url],
                stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=programs.DEADLINE,
                check=False)
            assert (found.returncode == 49) == (expected == 49), found.stderr
    assert not remains(server.process.pid, password.encode())


def bound(server, transport, name, password):
    """A client that is bound over TLS, in clear, or with a layer that signs what it leaves in clear."""
    client = ldap.initialize(server.secure_url if transport == "ldaps" else server.url)
    client.set_option(ldap.OPT_X_TLS_CACERTFILE, str(server.certificate))
    client.set_option(ldap.OPT_X_TLS_NEWCTX, 0)
    client.set_option(ldap.OPT_TIMEOUT, programs.DEADLINE)
    if transport == "starttls":
        client.start_tls_s()
    if transport == "layer":
        client.set_option(ldap.OPT_X_SASL_SECPROPS, "minssf=1,maxssf=1")
        client.sasl_interactive_bind_s("", ldap.sasl.sasl(
            {ldap.sasl.CB_AUTHNAME: name.partition("=")[2], ldap.sasl.CB_PASS: password},
            "DIGEST-MD5"))
    else:
        client.simple_bind_s(name, password)
    return client


@pytest.mark.parametrize("transport", ["clear", "ldaps", "starttls", "layer"])
def test_passwords_that_changes_set_are_wiped(request, tmp_path, transport):
    """What is stored is protected; the clear text is nowhere once the change is made or refused."""
    server = reader(request, tmp_path)
    if server is None:
        return

    connected = []

    def client_of(name, password):
        connected.append(bound(server, transport, name, password))
        return connected[-1]

    def check_what_the_layers_keep():
        """The SASL library's own packets: wiped by what is longer, and when the connection ends."""
        for password in passwords:
            check_copies(pid, password, most=2)
        root.search_s("", ldap.SCOPE_BASE, "(cn=%s)" % ("x" * 1000))
        assert not remains(pid, refused)
        while connected:
            connected.pop().unbind_s()
        until = time.monotonic() + programs.DEADLINE
        while any(remains(pid, password) for password in passwords):
            assert time.monotonic() < until

    pid = server.process.pid
    letters = (string.ascii_letters + string.digits + "!#$%&*+-./<=>?@").encode()
    # Long ones in which no character comes twice, nor in both: the policy counts those. In an order
    # that nobody else has.
    shuffled = bytes(letters[29 * i % len(letters)] for i in range(len(letters)))
    long, other = shuffled[::2], shuffled[1::2]
    added, changed = [b"Ka1#Tz8!mBn4", long], [b"Mo9#Qw2!vCx7", other]
    own, refused = b"Ri5#Hy3!sDf6", b"Lu4#Gp8!jEk2"
    passwords = (*added, *changed, own, refused)

    def change_password(client, name, password):
        client.modify_s(dn(name), [(ldap.MOD_REPLACE, "orv-slapdAdminPW", [password])])

    def dn(name):
        return "cn=%s,cn=admingroup,cn=configuration" % name

    def member(name, password):
        return [("objectClass", [b"top", b"orv-slapdConfigEntry", b"orv-slapdAdminGroupMember"]),
                ("cn", name.encode()), ("orv-slapdAdminDN", b"cn=" + name.encode()),
                ("orv-slapdDigestAdminUser", name.encode()),
                ("orv-slapdAdminRole", b"SchemaAdmin"), ("orv-slapdAdminPW", password)]

    bound(server, "clear", "cn=root", server.password).modify_s(
        "cn=digest,cn=configuration", [(ldap.MOD_REPLACE, "orv-slapdDigestAdminUser", [b"root"])])
    root = client_of("cn=root", server.password)
    for name, first, second in zip(("short", "long"), added, changed):
        root.add_s(dn(name), member(name, first))
        with pytest.raises(ldap.ALREADY_EXISTS):
            root.add_s(dn(name), member(name, first))
        change_password(root, name, second)
    with pytest.raises(ldap.UNDEFINED_TYPE):  # before the backend has it
        root.add_s(dn("third"), [*member("third", refused), ("orv-none", b"x")])
    change_password(client_of("cn=short", changed[0].decode()), "short", own)
    client_of("cn=short", own.decode())
    with pytest.raises(ldap.INVALID_CREDENTIALS):
        client_of("cn=short", changed[0].decode())
    clients.connect(server).search_s("", ldap.SCOPE_BASE)
    if transport == "layer":
        check_what_the_layers_keep()
    for password in passwords:
        assert not remains(pid, password), password
    assert holds(pid, server.config.path.name.encode())  # the search itself works


@pytest.fixture
def kerberized(instance, tmp_path, monkeypatch):
    """A server whose primary administrator has a ticket, which this process shows."""
    realm = kerberos.Realm(tmp_path / "realm")
    instance.config.set(clients.BASE, "orv-slapdMaxUnauthenticatedMessageSize", str(1 << 20))
    kerberos.with_kerberos(instance, realm.keytab("ldap/localhost"))
    for name, value in realm.ticket("admin").items():
        monkeypatch.setenv(name, value)
    yield instance.start(environment=realm.environment)
    realm.stop()


@pytest.mark.parametrize("strength", ["minssf=1,maxssf=1", "minssf=56"])
def test_passwords_under_a_layer_of_kerberos_are_wiped(request, tmp_path, strength):
    server = reader(request, tmp_path, "kerberized")
    if server is None:
        return
    pid = server.process.pid
    password = b"Ri5#Hy3!sDf6Wq8&xkcJu"
    client = ldap.initialize("ldap://localhost:%d" % server.port)
    client.set_option(ldap.OPT_X_SASL_NOCANON, 1)
    client.set_option(ldap.OPT_X_SASL_SECPROPS, strength)
    client.sasl_interactive_bind_s("", ldap.sasl.gssapi())
    with pytest.raises(ldap.UNDEFINED_TYPE):
        client.add_s("cn=third,cn=admingroup,cn=configuration", [
            ("objectClass", [b"top", b"orv-slapdConfigEntry", b"orv-slapdAdminGroupMember"]),
            ("cn", b"third"), ("orv-slapdAdminPW", password), ("orv-none", b"x")])
    client.add_s("cn=third,cn=admingroup,cn=configuration", [
        ("objectClass", [b"top", b"orv-slapdConfigEntry", b"orv-slapdAdminGroupMember"]),
        ("cn", b"third"), ("orv-slapdAdminDN", b"cn=third"),
        ("orv-slapdAdminRole", b"SchemaAdmin"), ("orv-slapdAdminPW", password)])
    # What the SASL library keeps is wiped by what is longer.
    check_copies(pid, password, most=2)
    client.search_s("", ldap.SCOPE_BASE, "(cn=%s)" % ("x" * 1000))
    assert not remains(pid, password)
    assert holds(pid, server.config.path.name.encode())  # the search itself works


# ---- keys, and core dumps

def key_of_stash(server):
    return bytes.fromhex(server.key_stash.read_text().split()[1])


def key_of_certificate(server):
    text = subprocess.run(["openssl", "pkey", "-in", server.directory / "tls.key", "-text", "-noout"],
                          check=True, text=True, stdout=subprocess.PIPE,
                          timeout=programs.DEADLINE).stdout
    digits = re.search(r"priv:\n((?:\s+[0-9a-f:]+\n)+)", text).group(1)
    return bytes.fromhex(re.sub(r"[^0-9a-f]", "", digits)).lstrip(b"\0")


def test_keys_are_only_in_memory_that_no_core_dump_shows(request, tmp_path):
    server = reader(request, tmp_path)
    if server is None:
        return
    pid = server.process.pid
    bound(server, "ldaps", "cn=root", server.password)
    server.process.send_signal(signal.SIGHUP)
    server.stderr.wait_for(lambda line: "settings taken over" in line)
    bound(server, "starttls", "cn=root", server.password)
    stash, private = key_of_stash(server), key_of_certificate(server)
    # Numbers are kept with their lowest byte first.
    places = [flags for key in (stash, private, private[::-1]) for flags in places_of(pid, key)]
    assert places, "the keys are nowhere"
    assert all("dd" in flags for flags in places), places
    assert next(places_of(pid, stash), None) and next(places_of(pid, private[::-1]), None)
    line = (server.directory / "tls.key").read_text().splitlines()[1].encode()
    assert not holds(pid, line[8:-8]) and not holds(pid, stash.hex().encode())


@pytest.mark.parametrize("secure", [False, True])
def test_passwords_on_their_way_are_only_in_memory_that_no_core_dump_shows(request, tmp_path,
                                                                           secure):
    server = reader(request, tmp_path)
    if server is None:
        return
    password = b"Vb6$" + b"kXr2&uDe" * 600  # more than one reading
    bind = wire.bind_request(1, "cn=root", password)
    client = socket.create_connection((server.host, server.secure_port if secure else server.port),
                                      programs.DEADLINE)
    if secure:
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_CLIENT)
        context.check_hostname = False
        context.verify_mode = ssl.CERT_NONE
        client = context.wrap_socket(client)
    with client:
        client.sendall(bind[:-1])
        until = time.monotonic() + programs.DEADLINE
        while not holds(server.process.pid, password[:-1]):  # all of it has been read
            assert time.monotonic() < until
        for part in (password[:24], password[-24:-1]):
            places = list(places_of(server.process.pid, part))
            assert places and all("dd" in flags for flags in places), places


def test_no_core_dump_is_written(instance):
    instance.start(wrapper=["prlimit", "--core=unlimited:unlimited"])
    with open("/proc/%d/limits" % instance.process.pid, encoding="utf-8") as limits:
        core = next(line for line in limits if line.startswith("Max core file size"))
    assert core.split()[4:6] == ["0", "0"]
    instance.process.send_signal(signal.SIGQUIT)
    _, status = os.waitpid(instance.process.pid, 0)
    instance.process.returncode = 0  # it has been waited for
    instance.kill()
    assert os.WTERMSIG(status) == signal.SIGQUIT and not os.WCOREDUMP(status)
