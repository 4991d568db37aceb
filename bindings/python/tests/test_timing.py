import asyncio
import threading
import time

import pytest

import kytreporting as kyt


def test_a_timer_sends_how_long_it_took(kyt_listener):
    with kyt.Session(20) as session:
        with session.timed(20, 1, step="index"):
            pass

        @session.timed(20, 2)
        def twice(number):
            """Doubles."""
            return 2 * number

        assert twice(4) == 8 and twice.__doc__ == "Doubles."
    first, second = kyt_listener.wait_for("message", 2)
    assert first["payload"]["step"] == "index" and 0 <= first["payload"]["duration"] < 10
    assert second["type"] == 2 and list(second["payload"]) == ["duration"]


def test_a_timer_names_the_error_and_keeps_nothing_back(kyt_listener):
    with kyt.Session(20) as session:
        timer = session.timed(20, 1)
        with pytest.raises(KeyError):
            with timer:
                raise KeyError("x")
    assert kyt_listener.wait_for("message")[0]["payload"]["error"] == "KeyError"
    with pytest.raises(KeyError):  # the session is closed: the caller's error still counts
        with timer:
            raise KeyError("x")


def test_a_timer_of_coroutines_measures_each_task(kyt_listener):
    with kyt.Session(20) as session:

        async def main():
            gate = asyncio.Event()

            @session.timed(20, 3)
            async def work():
                await gate.wait()

            tasks = [asyncio.create_task(work()) for _ in range(3)]
            await asyncio.sleep(0)
            gate.set()
            await asyncio.gather(*tasks)

        asyncio.run(main())
    assert len(kyt_listener.wait_for("message", 3)) == 3


def test_a_counter_sends_sums_when_its_interval_is_over(kyt_listener):
    with kyt.Session(20) as session:
        every = session.counter(21, 1, interval=0, kind="request")
        every.add()
        every.add(2)
        rest = session.counter(21, 2, interval=3600)
        threads = [threading.Thread(target=lambda: [rest.add() for _ in range(100)]) for _ in range(4)]
        for thread in threads:
            thread.start()
        for thread in threads:
            thread.join()
        assert session.statistics().accepted == 2
    payloads = [(m["type"], m["payload"]["count"]) for m in kyt_listener.wait_for("message", 3)]
    assert payloads == [(1, 1), (1, 2), (2, 400)]
    assert kyt_listener.events("message")[0]["payload"]["kind"] == "request"


def test_a_sum_of_nothing_does_not_leave(kyt_listener):
    with kyt.Session(20) as session:
        session.counter(21, 1)
    assert session.statistics().accepted == 0


def test_a_program_keeps_its_results_whatever_becomes_of_its_figures(kyt_listener, tmp_path):
    ended = kyt.Session(20)
    ended.close()
    alone = kyt.Session(20, socket=str(tmp_path / "none"), wait_for_daemon=False)
    for session in (ended, alone):
        counter = session.counter(21, 1, interval=0)

        @session.timed(20, 1)
        def answer():
            return 42

        @session.timed(20, 1)
        async def later():
            return 43

        assert answer() == 42 and asyncio.run(later()) == 43
        counter.add()
        with session.timed(20, 2):
            pass
    assert ended.statistics().dropped_closed == 4
    alone.close()


def test_what_cannot_be_meant_is_told_where_it_is_written(kyt_listener):
    with kyt.Session(20) as session:
        for make in (session.timed, session.counter):
            with pytest.raises(kyt.InvalidError):
                make(70000, 1)
            with pytest.raises(kyt.InvalidError):
                make(20, 1, field=object())


def test_a_sum_that_finds_no_room_goes_along_with_the_next(kyt_listener, monkeypatch):
    with kyt.Session(20) as session:
        counter = session.counter(21, 1, interval=0)
        monkeypatch.setattr(session, "send", lambda *arguments, **named: False)
        counter.add(3)
        counter.add(4)
        monkeypatch.undo()
        counter.add(5)
    (message,) = kyt_listener.wait_for("message")
    assert message["payload"]["count"] == 12 and message["payload"]["seconds"] > 0


def test_tasks_within_one_timer_keep_their_own_beginnings(kyt_listener):
    async def first(timer, leave):
        with timer:
            await leave.wait()

    async def run(session):
        timer, leave = session.timed(1, 1), asyncio.Event()
        task = asyncio.ensure_future(first(timer, leave))
        begun = time.perf_counter()
        while time.perf_counter() - begun < 0.05:
            await asyncio.sleep(0)
        with timer:  # its beginning is the last one of this thread
            leave.set()
            await task

    with kyt.Session(20) as session:
        asyncio.run(run(session))
    assert kyt_listener.wait_for("message", 2)[0]["payload"]["duration"] >= 0.04


def test_a_generator_is_timed_to_its_end(kyt_listener):
    with kyt.Session(20) as session:

        @session.timed(1, 1)
        def steps():
            begun = time.perf_counter()
            while time.perf_counter() - begun < 0.05:
                got = yield 1
            return got

        steps_now = steps()
        next(steps_now)
        with pytest.raises(StopIteration) as end:
            while True:
                steps_now.send("last")
    assert end.value.value == "last"
    [message] = kyt_listener.wait_for("message")
    assert message["payload"]["duration"] >= 0.05


def test_an_asynchronous_generator_is_not_decorated(kyt_listener):
    with kyt.Session(20) as session:
        with pytest.raises(kyt.InvalidError, match="asynchronous generator"):

            @session.timed(1, 1)
            async def steps():
                yield 1
