"""A crowd: thousands of connections, half of them slow or silent, while one is served."""

import asyncio
import contextlib

from orv_e2e import wire

from .actors import BASE
from .client import Client, Lost

PER_ADDRESS = 900           # connections from one loopback address
AT_ONCE = 100               # connections that are being made at a time
TLS_EVERY = 20              # every so many connections are over TLS
REQUESTS_PER_SECOND = 100   # of all of the crowd together
HOLD = 600                  # seconds that a slow client may take, by the settings


def prepare(instance, connections):
    """The limits that a crowd needs."""
    limits = {"MaxConnections": connections + 1000,
              "MaxConnectionsPerAddress": max(1024, PER_ADDRESS),
              "MaxUnauthenticatedConnections": connections + 1000,
              "MessageTimeOut": HOLD, "IdleTimeOut": 2 * HOLD}
    for name, value in limits.items():
        instance.config.set(BASE, "orv-slapd" + name, str(value))


class Crowd:
    def __init__(self, instance, context, connections):
        self.instance, self.context, self.size = instance, context, connections
        self.clients = []
        self.lost = []

    async def gather(self):
        """Connects everybody; every second one is silent or slow, the others have bound."""
        slots = asyncio.Semaphore(AT_ONCE)

        async def one(number):
            async with slots:
                self.clients.append(await self._newcomer(number))

        await asyncio.gather(*(one(number) for number in range(self.size)))

    async def _newcomer(self, number):
        source = "127.0.%d.%d" % divmod(2 + number // PER_ADDRESS, 256)
        transport = "ldaps" if number % TLS_EVERY == 1 else "clear"
        client = await Client.open(self.instance, transport, self.context, source)
        client.number = number
        client.request = wire.bind_request(1, "cn=root", "x" * 5000)
        if number % 2:
            if code := await client.bind("cn=root", self.instance.password):
                raise Lost(code, "bind refused")
        elif number % 4:
            client.writer.write(client.request[:7])
        return client

    async def live(self, seconds):
        """The slow ones send a byte now and then, the others a search."""
        end = asyncio.get_running_loop().time() + seconds
        order = sorted(self.clients, key=lambda client: client.number)
        at = 7
        served = 0
        while asyncio.get_running_loop().time() < end:
            for client in order:
                if asyncio.get_running_loop().time() >= end:
                    break
                if client.number % 4 == 0:
                    continue
                with self._noting(client):
                    if client.number % 2:
                        code, _ = await client.search(BASE, attributes=("cn",))
                        served += code == 0
                    else:
                        client.writer.write(client.request[at:at + 1])
                await asyncio.sleep(1 / REQUESTS_PER_SECOND)
            at += 1
        return served

    @contextlib.contextmanager
    def _noting(self, client):
        try:
            yield
        except (Lost, ConnectionError) as error:
            self.lost.append("connection %d: %r" % (client.number, error))

    def standing(self):
        return sum(not client.reader.at_eof() for client in self.clients)

    def leave(self):
        for client in self.clients:
            client.reset()
