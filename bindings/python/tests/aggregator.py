"""A session that aggregates another one of the same program, on the real chain: see PythonService_test.cpp. Prints what it
was told, a JSON object a line, and at the end its figures; its callback fails at each message of type 9."""

import json
import os
import sys
import threading

import kytreporting as kyt

TOKEN = os.urandom(16).hex()
last = threading.Event()


def told(message):
    line = {
        "session": (message.session_info or {}).get("SessionID", 0),
        "category": message.category,
        "type": message.type,
        "payload": message.payload,
        "is_last": message.is_last,
    }
    os.write(1, (json.dumps(line) + "\n").encode())
    if message.is_last:
        last.set()
    if message.type == 9:
        raise ValueError("not that one")


with kyt.Session(20, "service", "python", session_id=1, hierarchy=(TOKEN, 0), on_aggregated=told) as top:
    top.configure(60)
    with kyt.Session(20, "service", "python", session_id=2, hierarchy=(TOKEN, 1)) as below:
        below.configure(60)
        for number in range(3):
            below.send(12, 9, number=number, text="ä")
    os.write(1, b'{"ready": true}\n')
    if not last.wait(60):  # the daemon ends
        sys.exit("the aggregation did not end")
