"""The books of a service against what a daemon that keeps everything was told."""

import collections
import json
import os
import subprocess
import sys

from conftest import eventually


def test_the_books_agree_with_what_arrived_under_fifty_restarts_and_twenty_forks(kyt_listener, tmp_path):
    service = os.path.join(os.path.dirname(__file__), "service.py")
    told = tmp_path / "told"
    with open(told, "wb") as output:
        process = subprocess.Popen([sys.executable, service, "20"], stdout=output)
        try:
            for _ in range(50):
                before = len(kyt_listener.events("message"))
                kyt_listener.wait_for("message", before + 1, 30)
                kyt_listener.stop()
                kyt_listener.start()
            process.terminate()
            assert process.wait(120) == 0
        finally:
            process.kill()
            process.wait()
    # A connection may end before its program has said who it is.
    assert eventually(lambda: len(kyt_listener.events("end")) >= len(kyt_listener.events("session")))

    arrived = collections.defaultdict(list)
    for message in kyt_listener.events("message"):
        arrived[message["payload"]["process"]].append(message["payload"]["number"])
    books = [json.loads(line) for line in told.read_text().splitlines()]
    assert len(books) == 21
    assert set(arrived) <= {book["process"] for book in books}
    for book in books:
        numbers = arrived[book["process"]]
        # A lost message is missing here, one that was sent twice stands here twice.
        assert numbers == sorted(set(numbers)), book
        assert not numbers or numbers[-1] < book["taken"], book
        assert book["accepted"] == book["taken"], book
        assert book["queued"] == 0, book
        kept_back = book["lost_in_queue"] + book["dropped_unsendable"] + book["dropped_too_late"]
        assert book["accepted"] == book["sent"] + book["lost_on_connection_end"] + kept_back, book
        # What a connection's end cut off may have arrived, or not.
        assert book["sent"] <= len(numbers) <= book["sent"] + book["lost_on_connection_end"], (len(numbers), book)
    assert sum(book["taken"] for book in books) >= 20 * 50 + 50
