"""Who takes part in a soak: administrators who search and change, listeners, members who come and
go, clients that mean no good, and an editor of the file."""

import asyncio
import contextlib
import fcntl
import random
import socket

from orv_e2e import clients as blocking
from orv_e2e import wire
from orv_e2e.changes import PASSWORD, PLACE, container, member
from orv_e2e.config_file import dn_key, record
from orv_e2e.programs import DEADLINE

from .client import (Client, Lost, TRANSPORTS, add_operation, delete_operation, persistent_control,
                     replace_operation, search_operation)

BASE = "cn=configuration"
BY_HAND = "cn=by hand," + PLACE
REMARK = b"# a remark of an editor\n"
NAMES = 10           # entries that one administrator may have at a time
LISTENERS = 60       # at most: the server bounds persistent searches
CUT_OFF = 3          # seconds after which the server cuts stalled clients off, by its settings

# Answers besides success that do not count as a failure: the file cannot be read just now (1), or
# somebody else is writing it, or the turn did not come (51). Nothing was changed then.
EXCUSED = (1, 51)


class Failure(Exception):
    """The server did what it must not do."""


class Stage:
    """What all of them share."""

    def __init__(self, instance, context, pause, seed):
        self.instance, self.context, self.pause = instance, context, pause
        self.password = instance.password
        self.random = random.Random(seed)
        self.over = asyncio.Event()
        self.counts = {}
        self.failures = []
        self.present = {}   # DN: the description that was acknowledged, None for gone
        self.pending = {}   # DN: what it becomes if the change that was not answered was made
        self.unsure = {}    # DN: all that changes whose client left may have made of it

    def count(self, what):
        self.counts[what] = self.counts.get(what, 0) + 1

    async def rest(self, longest=None):
        """A pause of a random length, cut short by the end."""
        with contextlib.suppress(asyncio.TimeoutError):
            await asyncio.wait_for(self.over.wait(),
                                   self.random.uniform(0, longest or 2 * self.pause))

    async def run(self, actor):
        """Lets an actor act until the end; what it throws is a failure of the server."""
        try:
            while not self.over.is_set():
                await actor.act()
                await self.rest()
        except Exception as error:  # pylint: disable=broad-except
            self.failures.append("%s: %r" % (type(actor).__name__, error))
        finally:
            await actor.leave()


def check(code, what):
    """Whether it was done; neither done nor excused is a failure."""
    if code and code not in EXCUSED:
        raise Failure("%s was answered with %d" % (what, code))
    return code == 0


class Actor:
    """Somebody with at most one connection, over a random transport, that lasts for a while."""

    def __init__(self, stage):
        self.stage = stage
        self.random = random.Random(stage.random.random())
        self.client = None

    async def connect(self, who="cn=root", password=None):
        transport = self.random.choice(TRANSPORTS)
        client = await Client.open(self.stage.instance, transport, self.stage.context)
        if await client.bind(who, self.stage.password if password is None else password):
            raise Failure("bind as %s over %s refused" % (who, transport))
        self.stage.count("connections over " + transport)
        return client

    async def leave(self):
        if self.client:
            self.client.close()
            self.client = None


class Administrator(Actor):
    """Changes entries of its own, and looks for what it was told is there."""

    def __init__(self, stage, number):
        super().__init__(stage)
        self.number = number
        self.changes = 0

    async def act(self):
        if self.client and self.random.random() < 0.02:
            await self.leave()
        if self.client is None:
            self.client = await self.connect()
        deed = self.random.choices(
            (self.change, self.look, self.browse, self.rebind, self.abandon, self.root_dse),
            (40, 25, 10, 8, 10, 7))[0]
        await deed()
        self.stage.count(deed.__name__)

    def dn(self):
        return "cn=soak %d %d,%s" % (self.number, self.random.randrange(NAMES), PLACE)

    async def change(self):
        dn = self.dn()
        self.changes += 1
        text = "%d of %d" % (self.changes, self.number)
        if self.stage.present.get(dn) is None:
            name = dn.split(",", 1)[0].split("=", 1)[1]
            wanted = text
            operation = add_operation(*container(name, description=_pair(text)))
        elif self.random.random() < 0.7:
            wanted, operation = text, replace_operation(dn, "description", _pair(text))
        else:
            wanted, operation = None, delete_operation(dn)
        self.stage.pending[dn] = wanted
        code, _ = await self.client.call(operation)
        del self.stage.pending[dn]
        self.stage.count("changes answered with %d" % code)
        if check(code, "a change"):
            self.stage.present[dn] = wanted

    async def look(self):
        """Exactly what was acknowledged is there."""
        dn = self.dn()
        code, entries = await self.client.search(dn)
        wanted = self.stage.present.get(dn)
        if code in EXCUSED:
            return
        if code not in (0, 32) or (code == 32) != (wanted is None):
            raise Failure("%s: %d, acknowledged was %s" % (dn, code, wanted))
        if wanted is not None and descriptions(entries[0][1]) != wanted:
            raise Failure("%s is %s, acknowledged was %s" % (dn, entries[0][1], wanted))

    async def browse(self):
        scope = self.random.choice((1, 2))
        search_filter = self.random.choice((
            None, wire.equal("cn", "soak %d 1" % self.number),
            wire.all_of(wire.present("description"), wire.negated(wire.equal("cn", "x")))))
        code, _ = await self.client.search(PLACE, scope, search_filter,
                                           self.random.choice((("1.1",), ("cn",), ())))
        check(code, "a search")

    async def rebind(self):
        """A bind that fails leaves nobody; the next one makes an administrator again."""
        if await self.client.bind("cn=root", "wrong") != 49:
            raise Failure("a wrong password was not answered with 49")
        if (await self.client.search(BASE))[0] != 50:
            raise Failure("the bind before outlived one that failed")
        if await self.client.bind("cn=root", self.stage.password):
            raise Failure("the right password was refused")

    async def abandon(self):
        search = self.client.send(search_operation(BASE, 2))
        self.client.send(wire.number(search, 0x50))
        await self.root_dse()

    async def root_dse(self):
        code, entries = await self.client.search("")
        if code or len(entries) != 1:
            raise Failure("the root DSE was answered with %d" % code)


def _pair(text):
    return [text, "and " + text]


def descriptions(attributes):
    """What both values say; a pair that does not agree is half a change."""
    first, second = sorted((value.decode() for value in attributes.get("description", [b"", b""])),
                           key=len)
    return first if second == "and " + first else "torn: %s and %s" % (first, second)


class Listener(Actor):
    """Has a persistent search, hears of some changes, and starts anew."""

    async def act(self):
        if self.client is None:
            self.client = await self.connect()
        search = self.client.send(search_operation(PLACE, 1, None, ("cn",)), persistent_control())
        for _ in range(20):
            try:
                answer = await asyncio.wait_for(self.client.answer(), 1)
            except asyncio.TimeoutError:
                if self.stage.over.is_set():
                    return
                continue
            self.stage.count("notices heard")
            if answer.message_id == search and answer.tag == wire.SEARCH_DONE:
                check(answer.code, "a persistent search")
                return
        self.client.send(wire.number(search, 0x50))
        code, _ = await self.client.search("")
        check(code, "a search behind an abandoned one")
        if self.random.random() < 0.3:
            await self.leave()


class Guest(Actor):
    """A member of the group: is added, binds, changes its password, is deleted, and is told so."""

    def __init__(self, stage, number):
        super().__init__(stage)
        self.name = "guest %d" % number
        self.there = False

    async def act(self):
        if self.client is None:
            self.client = await self.connect()
        dn, attributes = member(self.name, roles=["AuditAdmin"])
        if not self.there:
            code, _ = await self.client.call(add_operation(dn, attributes))
            self.there = check(code, "the add of a member")
            return
        own = await self.connect("cn=" + self.name, PASSWORD)
        try:
            check((await own.search(dn))[0], "a member's search")
            await self.stage.rest()
            self.there = not check((await self.client.call(delete_operation(dn)))[0],
                                   "the delete of a member")
            if not self.there:
                await self._ends(own)
        finally:
            own.close()

    async def _ends(self, own):
        try:
            while True:
                if (await own.search(BASE))[0] not in (50, *EXCUSED):
                    raise Failure("a member that is gone was served")
        except (Lost, ConnectionError):
            self.stage.count("members dropped")

    async def leave(self):
        if self.client and self.there:
            with contextlib.suppress(Lost, OSError, asyncio.TimeoutError):
                await self.client.call(delete_operation(member(self.name)[0]))
        await super().leave()


class Nuisance(Actor):
    """Somebody who means no good. Whatever it does, its connection ends in time."""

    def __init__(self, stage, number):
        super().__init__(stage)
        self.name = "soak nuisance %d" % number
        self.changes = 0

    async def act(self):
        deed = self.random.choice((self.garbage, self.stall, self.half, self.drip, self.hoard,
                                   self.vanish, self.vanish_in_a_change, self.silence,
                                   self.half_handshake, self.nonsense_for_tls))
        reader, writer = await self._raw(deed in (self.half_handshake, self.nonsense_for_tls))
        try:
            await deed(reader, writer)
            self.stage.count("nuisance: " + deed.__name__)
        except ConnectionError:
            self.stage.count("nuisance: " + deed.__name__)
        finally:
            writer.transport.abort()

    async def _raw(self, secure=False):
        raw = socket.socket()
        raw.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 4096)
        raw.setblocking(False)
        server = self.stage.instance
        await asyncio.get_running_loop().sock_connect(
            raw, (server.host, server.secure_port if secure else server.port))
        # A reader that holds little: what is not asked for stays in the server.
        return await asyncio.open_connection(sock=raw, limit=1024)

    async def _cut_off(self, reader, seconds=CUT_OFF + DEADLINE):
        """Reads until the server ends the connection; it must, in time."""
        try:
            async with asyncio.timeout(seconds):
                while await reader.read(1 << 16):
                    pass
        except asyncio.TimeoutError:
            if not self.stage.over.is_set():
                raise Failure("a bad client was not cut off") from None

    async def garbage(self, reader, writer):
        # The first byte is none that an LDAP message begins with, or one that claims too much.
        first = self.random.choice((b"\x00", b"\xff", b"GET / HTTP/1.0\r\n", b"\x30\x84\x7f"))
        writer.write(first + self.random.randbytes(self.random.randrange(5, 2000)))
        await self._cut_off(reader)

    def _bind(self):
        return wire.bind_request(1, "cn=root", self.stage.password)

    async def stall(self, reader, writer):
        writer.write(self._bind()[:self.random.randrange(1, 8)])
        await self._cut_off(reader)

    async def half(self, reader, writer):
        writer.write(self._bind() + wire.search_request(2, scope=2)[:-5])
        writer.write_eof()
        await self._cut_off(reader)

    async def drip(self, reader, writer):
        """Never silent for long, and never done."""
        message = wire.bind_request(1, "cn=root", "x" * 1000)
        ended = asyncio.ensure_future(self._cut_off(reader))
        for at in range(len(message) - 1):
            writer.write(message[at:at + 1])
            if (await asyncio.wait({ended}, timeout=0.1))[0]:
                break
        await ended

    async def hoard(self, reader, writer):
        """Asks for everything again and again and reads nothing."""
        writer.write(self._bind())
        for number in range(2, 60):
            writer.write(wire.search_request(number, scope=2, attributes=()))
        await self.stage.rest(3 * CUT_OFF)
        del reader

    async def vanish(self, reader, writer):
        """Is gone by a reset in the middle of an answer."""
        writer.write(self._bind())
        await reader.read(10)
        request = wire.search_request(2, scope=2, attributes=())
        writer.write(request)
        if self.random.random() < 0.5:
            await reader.read(10)

    async def vanish_in_a_change(self, reader, writer):
        """Does not wait for the answer to a change, which is made wholly or not at all."""
        dn, attributes = container(self.name)
        possible = self.stage.unsure.setdefault(dn, {None})
        self.changes += 1
        text = "%d of %s" % (self.changes, self.name)
        possible.add(text)
        add = add_operation(dn, {**attributes, "description": _pair(text)})
        change = replace_operation(dn, "description", _pair(text))
        writer.write(self._bind())
        await reader.read(10)
        writer.write(b"".join(wire.message(number, operation)
                              for number, operation in ((2, add), (3, change))))
        if self.random.random() < 0.5:
            await reader.read(10)

    async def half_handshake(self, reader, writer):
        writer.write(b"\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03"[:self.random.randrange(1, 11)])
        await self._cut_off(reader)

    async def nonsense_for_tls(self, reader, writer):
        writer.write(b"\x17\x03\x03\x00\x20" + self.random.randbytes(32))
        await self._cut_off(reader)

    async def silence(self, reader, writer):
        await self.stage.rest(2 * CUT_OFF)
        del reader, writer


class Editor:
    """Edits the file as people do who keep to the lock: a description, with comments and folded
    lines; and now and then something that is no configuration, which is then repaired."""

    def __init__(self, stage):
        self.stage = stage
        self.random = random.Random(stage.random.random())
        self.client = None
        self.number = 0
        self.lock = str(stage.instance.config.path) + ".lock"

    async def act(self):
        if self.client is None:
            self.client = await Client.open(self.stage.instance)
            await self.client.bind("cn=root", self.stage.password)
        await (self._break_and_mend() if self.random.random() < 0.3 else self._edit())
        await self.stage.rest(1)

    @contextlib.asynccontextmanager
    async def _locked(self):
        """The lock; whoever has it must not wait for the server, which may be waiting for it."""
        with open(self.lock, "ab") as file:
            while True:
                try:
                    fcntl.flock(file, fcntl.LOCK_EX | fcntl.LOCK_NB)
                    break
                except BlockingIOError:
                    await asyncio.sleep(0.002)
            yield

    async def _edit(self):
        self.number += 1
        config = self.stage.instance.config
        async with self._locked():
            config.replace(config.read().replace(REMARK, b""))
            config.set(BY_HAND, "description", "edit %d" % self.number)
            config.replace(config.read().replace(
                b"edit %d\n" % self.number, b"ed\n it %d\n" % self.number + REMARK))
        code, entries = await self.client.search(BY_HAND, attributes=("description",))
        wanted = {"description": [b"edit %d" % self.number]}
        if code not in (0, 51) or code == 0 and entries[0][1] != wanted:
            raise Failure("an edit is not seen: %d, %s" % (code, entries))
        self.stage.count("edits")

    async def _break_and_mend(self):
        config = self.stage.instance.config
        async with self._locked():
            good = config.read()
            cut = self.random.randrange(len(good) // 2, len(good) - 10)
            config.replace(self.random.choice((
                good[:cut] + b"\nno such line", good + b"\ndn: cn=a,cn=nowhere\ncn: a\n", b"",
                good.replace(b"dn: CN=CONFIGURATION\n", b"dn CN=CONFIGURATION\n", 1))))
            search = self.client.send(search_operation(BY_HAND))
            await self.stage.rest(0.2)
            config.replace(good)
        # It may have had to wait until the file was good again.
        code, _ = await self.client.result(search)
        self.stage.count("broken file was answered with %d" % code)
        check(code, "a search of a broken file")
        code, _ = await self.client.search(BY_HAND)
        if code not in (0, 51):
            raise Failure("a search of a repaired file was answered with %d" % code)
        self.stage.count("breaks repaired")

    async def leave(self):
        if self.client:
            self.client.close()


def cast(stage, connections):
    """Half of them administrators, a tenth listeners, a tenth members, the others nuisances."""
    administrators = connections // 2
    listeners = min(connections // 10, LISTENERS)
    guests = connections // 20
    actors = [Administrator(stage, number) for number in range(administrators)]
    actors += [Listener(stage) for _ in range(listeners)]
    actors += [Guest(stage, number) for number in range(guests)]  # two connections each
    actors += [Nuisance(stage, number) for number in range(connections - len(actors) - guests)]
    return [*actors, Editor(stage)]


def missing_or_torn(stage):
    """What is not in the file as it was acknowledged."""
    found = blocking.parse_ldif(stage.instance.config.read())
    there = {dn: descriptions(attributes) for dn, attributes in found.items()
             if dn.startswith("cn=soak ")}
    known = {**dict.fromkeys(stage.pending), **stage.present}
    wrong = ["%s is %s, acknowledged was %s" % (dn, there.get(dn), text)
             for dn, text in known.items()
             if there.get(dn_key(dn)) not in (text, stage.pending.get(dn, text))]
    unsure = {dn_key(dn): texts for dn, texts in stage.unsure.items()}
    wrong += ["%s is %s, which nobody made" % (dn, there[dn])
              for dn in set(there) - {dn_key(dn) for dn in known}
              if there[dn] not in unsure.get(dn, {None})]
    wrong += ["%s is left" % dn for dn in found if dn.startswith("cn=guest ")]
    return wrong


def prepare(instance, filling):
    """Settings of a soak, and entries that make answers long."""
    config = instance.config
    for name in ("MessageTimeOut", "WriteTimeOut", "TlsHandshakeTimeOut"):
        config.set(BASE, "orv-slapd" + name, str(CUT_OFF))
    config.set("cn=pwdpolicy admin," + BASE, "pwdLockout", "FALSE")
    records = [(BY_HAND, {"objectClass": ["top", "container"], "cn": ["by hand"]})]
    records += [container("filling %d" % number, description=["x" * 2000])
                for number in range(filling)]
    config.append(b"\n".join(record(dn, list(attributes.items())) for dn, attributes in records))
