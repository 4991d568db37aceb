import ctypes
import datetime
import gc
import os
import sys
import threading

import pytest
from conftest import eventually

import kytreporting as kyt

TOKEN = "9b2f6d0c5e7a4813a1f0c3d2b4e59687"


def test_a_session_gets_its_own_messages_and_those_beneath_it(kyt_listener):
    received = []
    with kyt.Session(20, "call", hierarchy=(TOKEN, 0), on_aggregated=received.append) as call:
        kyt_listener.wait_for("configuration")
        with kyt.Session(20, "stream", session_id=7, hierarchy=(TOKEN, 1)) as stream:
            kyt_listener.wait_for("configuration", 2)
            stream.send(12, 3, frames=240)
            assert eventually(lambda: len(received) == 1)
        call.send(11, 1)
        assert eventually(lambda: len(received) == 2)
    assert [(message.category, message.type) for message in received] == [(12, 3), (11, 1)]
    assert received[0].payload == {"frames": 240}
    assert received[0].session_info["SessionID"] == 7
    assert received[0].session_info["HierarchyToken"] == {"TokenID": TOKEN, "Level": 1}
    assert received[0].session_info["ClientName"] == "stream"
    assert abs(received[0].timestamp - datetime.datetime.now().timestamp()) < 600
    assert received[1].payload == {}
    assert not received[0].is_last


def test_a_value_of_each_kind_comes_as_it_was_sent(kyt_listener):
    received = []
    sent = {
        "text": "ä €",
        "empty": "",
        "yes": True,
        "least": -(2**63),
        "most": 2**64 - 1,
        "real": 0.25,
        "data": b"x\0y",
        "nothing": b"",
        "date": datetime.datetime(2026, 11, 22, 12, 0, 0, 250000, datetime.timezone.utc),
        "list": [1, "two", [3.5], {"four": False}, b"5"],
        "mapping": {"inner": {"k": [True, {}]}, "n": -1},
    }
    with kyt.Session(20, on_aggregated=received.append) as session:
        kyt_listener.wait_for("configuration")
        session.send(1, 1, sent)
        assert eventually(lambda: received)
    assert received[0].payload == sent
    assert list(received[0].payload) == list(sent)
    assert {key: type(value) for key, value in received[0].payload.items()} == {
        key: type(value) for key, value in sent.items()
    }


def test_the_callback_runs_with_the_interpreters_lock_on_one_thread(kyt_listener):
    held, threads = [], set()
    stop = threading.Event()

    def told(message):
        held.append(ctypes.pythonapi.PyGILState_Check())
        threads.add(threading.get_ident())

    def spin():
        while not stop.is_set():
            sum(range(1000))

    spinning = threading.Thread(target=spin)
    spinning.start()
    try:
        with kyt.Session(20, on_aggregated=told) as session:
            kyt_listener.wait_for("configuration")
            for number in range(500):
                session.send(1, 1, number=number)
            assert eventually(lambda: len(held) == 500)
    finally:
        stop.set()
        spinning.join()
    assert held == [1] * 500
    assert len(threads) == 1 and threading.get_ident() not in threads


def test_an_exception_in_it_is_reported_and_ends_nothing(kyt_listener, monkeypatch):
    reported, received = [], []
    monkeypatch.setattr(sys, "unraisablehook", lambda args: reported.append(args.exc_value))

    def told(message):
        received.append(message.type)
        if message.type == 1:
            raise ValueError("not that one")
        if message.type == 2:
            sys.exit(5)

    with kyt.Session(20, on_aggregated=told) as session:
        kyt_listener.wait_for("configuration")
        for kind in (1, 2, 3):
            session.send(1, kind)
        assert eventually(lambda: received == [1, 2, 3])
        session.send(1, 4)
        assert eventually(lambda: received == [1, 2, 3, 4])
    assert [type(error) for error in reported] == [ValueError, SystemExit]
    assert str(reported[0]) == "not that one"


def test_a_program_prints_the_exception_and_goes_on(kyt_listener):
    import subprocess

    text = (
        "import threading\n"
        "import kytreporting as kyt\n"
        "came = threading.Event()\n"
        "def told(message):\n"
        "    came.set()\n"
        "    raise ValueError('not that one')\n"
        "with kyt.Session(20, on_aggregated=told) as session:\n"
        "    while not came.wait(0.01):\n"
        "        session.send(1, 1)\n"
        "    assert session.finish(30)\n"
        "print('went on')\n"
    )
    done = subprocess.run([sys.executable, "-c", text], capture_output=True, text=True, timeout=60, check=False)
    assert (done.returncode, done.stdout) == (0, "went on\n")
    assert "ValueError: not that one" in done.stderr


def test_it_may_not_wait_for_an_answer(kyt_listener):
    errors = []

    def told(message):
        try:
            session.flush()
        except RuntimeError as error:
            errors.append(str(error))

    with kyt.Session(20, on_aggregated=told) as session:
        kyt_listener.wait_for("configuration")
        session.send(1, 1)
        assert eventually(lambda: errors)
    assert "may not wait" in errors[0]


def test_it_may_send(kyt_listener):
    received = []

    def told(message):
        received.append(message.type)
        if message.type < 5:
            session.send(1, message.type + 1)

    with kyt.Session(20, on_aggregated=told) as session:
        kyt_listener.wait_for("configuration")
        session.send(1, 1)
        assert eventually(lambda: received == [1, 2, 3, 4, 5])


def test_none_runs_once_the_session_is_closed(kyt_listener):
    received = []
    session = kyt.Session(20, on_aggregated=received.append)
    kyt_listener.wait_for("configuration")
    for _ in range(1000):
        session.send(1, 1)
    assert eventually(lambda: received)
    session.close()
    count = len(received)
    kyt_listener.wait_for("end")
    assert len(received) == count


def test_a_session_that_nobody_holds_tells_nobody(kyt_listener):
    received = []
    session = kyt.Session(20, on_aggregated=received.append)
    kyt_listener.wait_for("configuration")
    for _ in range(1000):
        session.send(1, 1)
    del session
    gc.collect()
    kyt_listener.wait_for("end")
    count = len(received)
    assert kyt.total_statistics().queued == 0
    assert len(received) == count


@pytest.mark.parametrize("where", ["child", "parent"])
def test_after_a_fork_each_is_told_of_its_own(kyt_listener, where):
    received = []
    session = kyt.Session(20, on_aggregated=received.append)
    kyt_listener.wait_for("configuration")
    child = os.fork()
    if child == 0:
        status = 1
        try:
            session.send(1, 2)
            if eventually(lambda: received) and [message.type for message in received] == [2]:
                status = 0
        finally:
            os._exit(status)
    if where == "parent":
        session.send(1, 1)
    assert os.waitpid(child, 0)[1] == 0
    if where == "parent":
        assert eventually(lambda: received)
        assert [message.type for message in received] == [1]
    session.close()
    assert where == "parent" or received == []


def test_the_end_of_an_aggregation_is_seen():
    assert kyt.Aggregated(None, 0.0, 0, 0, None).is_last
    assert not kyt.Aggregated({}, 0.0, 0, 0, {}).is_last
