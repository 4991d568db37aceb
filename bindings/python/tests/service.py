"""A service that reports without an end: see PythonService_test.cpp. Forks as often as its argument says; at SIGTERM it
finishes. Each process prints its number, how many messages it was told were taken, and its figures: a JSON object a line.
Each message says which of its process' it is, so that whoever receives them can count."""

import dataclasses
import json
import os
import signal
import sys
import threading
import time

import kytreporting as kyt

ended = threading.Event()
signal.signal(signal.SIGTERM, lambda *_: ended.set())
signal.signal(signal.SIGALRM, lambda *_: os._exit(3))
session = kyt.Session(20, "service", "python", batch=True, finish_waits_for_daemon=True)
taken = 0


def tell(finished):
    said = {"process": os.getpid(), "taken": taken, "finished": finished}
    said.update(dataclasses.asdict(session.statistics()))
    os.write(1, (json.dumps(said) + "\n").encode())


def report(kind):
    """The queue is full while no daemon is there."""
    global taken
    while not session.send(10, kind, process=os.getpid(), number=taken):
        time.sleep(0.001)
    taken += 1


forks = int(sys.argv[1])
children = []
while not ended.is_set() or forks > 0:
    for _ in range(20):
        report(1)
    if forks > 0:
        forks -= 1
        child = os.fork()
        if child == 0:
            signal.alarm(60)
            taken = 0
            for _ in range(50):
                report(2)
            tell(session.finish(50))
            os._exit(0)
        children.append(child)
    ended.wait(0.02)
for child in children:
    if os.waitpid(child, 0)[1] != 0:
        sys.exit("a child failed")
tell(session.finish(50))
