"""The soak's servers: one that fails, for wild programs and storebags, and the sink of steady programs' events."""

import asyncio
import gzip
import json
import random
import ssl
import subprocess
import threading
import urllib.request


class Sink:
    """The server of steady programs' events, a process of its own that never fails."""

    def __init__(self, program, certificate):
        self.process = subprocess.Popen([program, *certificate], stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True)
        ports = json.loads(self.process.stdout.readline())
        self.plain, self.tls = f"http://127.0.0.1:{ports['plain']}", f"https://127.0.0.1:{ports['tls']}"

    def get(self, path):
        with urllib.request.urlopen(self.plain + path, timeout=60) as reply:
            return reply.read()

    def book(self, nonce):
        """A byte for each number of that program: how often it arrived."""
        return self.get("/books/" + nonce)

    def figures(self):
        return json.loads(self.get("/figures"))

    def close(self):
        self.process.stdin.close()
        self.process.wait(60)


class FailingServer(threading.Thread):
    """The server of storebags and of wild programs' events, plain and over TLS, with a loop and a thread of its own."""

    def __init__(self, certificate, seed):
        super().__init__(daemon=True)
        self.certificate = certificate
        self.random = random.Random(seed)
        self.bags = {}
        self.arrived = {}  # nonce -> {(back end, number): times}
        self.heard = 0  # whole requests
        self.faulty_connections = set()
        self.lock = threading.Lock()
        self.ready = threading.Event()
        self.plain = self.tls = ""

    def run(self):
        self.loop = asyncio.new_event_loop()
        asyncio.set_event_loop(self.loop)
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(*self.certificate)

        async def start():
            plain = await asyncio.start_server(self.serve, "127.0.0.1", 0, backlog=1024)
            tls = await asyncio.start_server(self.serve, "127.0.0.1", 0, ssl=context, backlog=1024)
            self.plain = f"http://127.0.0.1:{plain.sockets[0].getsockname()[1]}"
            self.tls = f"https://127.0.0.1:{tls.sockets[0].getsockname()[1]}"
            self.ready.set()

        self.loop.run_until_complete(start())
        self.loop.run_forever()

    async def serve(self, reader, writer):
        try:
            while True:
                head = await reader.readuntil(b"\r\n\r\n")
                first, *lines = head.decode("latin-1").split("\r\n")
                method, target = first.split(" ")[:2]
                headers = {}
                for line in lines:
                    name, _, value = line.partition(":")
                    headers[name.lower()] = value.strip()
                if headers.get("expect") == "100-continue":
                    writer.write(b"HTTP/1.1 100 Continue\r\n\r\n")
                body = await reader.readexactly(int(headers.get("content-length", 0)))
                self.heard += 1
                if method == "GET":
                    reply = self.bags.get(target.split("?")[0])
                    self.answer(writer, 200 if reply else 404, reply or b"", "Cache-Control: max-age=1\r\n")
                elif not await self.fail(writer, target, headers, body):
                    break
                await writer.drain()
        except (asyncio.IncompleteReadError, asyncio.LimitOverrunError, ConnectionError, ssl.SSLError, OSError):
            pass
        finally:
            self.faulty_connections.discard(writer)
            writer.close()

    @staticmethod
    def answer(writer, status, body=b"", headers=""):
        writer.write(f"HTTP/1.1 {status} Reply\r\n{headers}Content-Length: {len(body)}\r\n\r\n".encode() + body)

    async def fail(self, writer, target, headers, body):
        """Whether the connection goes on."""
        self.faulty_connections.add(writer)
        choice = self.random.randrange(12)
        if choice == 0:
            writer.transport.abort()
            return False
        if choice == 1:
            return False
        self.take(target.split("/")[2], headers, body)
        if choice == 2:
            self.answer(writer, self.random.choice([400, 404, 429, 500, 502, 503, 599]))
        elif choice == 3:
            writer.write(b"HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nhalf")
            return False
        elif choice == 4:
            await asyncio.sleep(self.random.uniform(0, 5))
            self.answer(writer, 200)
        elif choice == 5:
            writer.write(b"\x00garbage\r\n\r\n")
            return False
        elif choice == 6:
            self.answer(writer, 200, b"x" * self.random.randrange(1 << 20))
        elif choice == 7:
            self.answer(writer, 200)
            return False
        else:
            self.answer(writer, 200)
        return True

    def take(self, backend, headers, body):
        try:
            text = gzip.decompress(body) if headers.get("content-encoding") == "gzip" else body
            records = json.loads(text).get("events", [])
        except (ValueError, OSError, AttributeError):
            return  # a file, or log data
        with self.lock:
            for record in records:
                if "nonce" in record:
                    numbers = self.arrived.setdefault(record["nonce"], {})
                    event = (backend, record["number"])
                    numbers[event] = numbers.get(event, 0) + 1

    def forget(self, nonces):
        with self.lock:
            for nonce in nonces:
                self.arrived.pop(nonce, None)

    def events_of(self, nonce):
        with self.lock:
            return dict(self.arrived.get(nonce, {}))

    def cut(self):
        def close():
            for writer in list(self.faulty_connections):
                writer.transport.abort()

        self.loop.call_soon_threadsafe(close)
