"""What programs write about their events, and what lets them wait."""

import array
import os
import struct
import threading
import time

MOST_EVENTS = 1 << 22  # of one program in one round
FIRST_NUMBER = 2
# Steady programs wait while so many of their events are under way, until fewer are. More than a daemon can post is not
# asked of it: what waits there counts against its user's share of memory, and beyond that is dropped.
MOST_UNDER_WAY, FEW_UNDER_WAY = 4000, 1000
NEVER, HANDED_OVER, ACCEPTED, REFUSED = range(4)  # a book's entries, as the programs write them


class Book:
    """What a program has written about each event that it handed over."""

    def __init__(self, path):
        self.path = path
        with open(path, "wb") as file:
            file.truncate(8 * MOST_EVENTS)
        os.chmod(path, 0o666)

    def handed_over(self):
        with open(self.path, "rb") as file:
            return struct.unpack("q", file.read(8))[0]

    def hold(self, holds):
        with open(self.path, "r+b") as file:
            file.seek(8)
            file.write(struct.pack("q", holds))

    def close(self):
        entries = array.array("q")
        with open(self.path, "rb") as file:
            # The rest of the file has never been written.
            while True:
                chunk = file.read(1 << 20)
                entries.frombytes(chunk)
                if not chunk or not any(chunk[-8:]):
                    break
        os.unlink(self.path)
        self.entries = entries

    def became(self, number):
        return self.entries[number] & 3 if number < len(self.entries) else NEVER

    def seconds(self, number):
        return (self.entries[number] >> 2) / 1000


class Pacer(threading.Thread):
    """Lets steady programs wait for the daemon, so that the load is what it can take."""

    def __init__(self, sink, books):
        super().__init__(daemon=True)
        self.sink, self.books = sink, books
        self.over = threading.Event()

    def run(self):
        # What was lost in a fault will never arrive: it is not under way once nothing else arrives any more.
        base, arrived, changed, holds = self.sink.figures()["events"], -1, time.monotonic(), False
        while not self.over.wait(0.03):
            now, former = time.monotonic(), arrived
            try:
                arrived = self.sink.figures()["events"]
            except OSError:
                continue  # the sink is busy
            under_way = sum(book.handed_over() for book in self.books) - (arrived - base)
            if arrived != former:
                changed = now
            elif holds and now - changed > 1:
                base -= under_way
                under_way = 0
            if under_way > MOST_UNDER_WAY and not holds or under_way < FEW_UNDER_WAY and holds:
                holds = not holds
                for book in self.books:
                    book.hold(holds)
        for book in self.books:
            book.hold(False)

    def end(self):
        self.over.set()
        self.join()
