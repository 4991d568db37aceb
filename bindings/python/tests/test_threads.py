import gc
import threading

from conftest import closes, eventually

import kytreporting as kyt


def test_threads_report_through_one_session(kyt_listener):
    with kyt.Session(20, max_queued_messages=65536, max_queued_bytes=1 << 28) as session:
        taken = []

        def report(thread):
            taken.append(sum(session.send(1, thread, number=number) for number in range(500)))

        threads = [threading.Thread(target=report, args=(number,)) for number in range(8)]
        for thread in threads:
            thread.start()
        for thread in threads:
            thread.join()
        assert session.finish(30)
        assert sum(taken) == session.statistics().sent == 4000
        assert closes(session.statistics())
    kyt_listener.wait_for("message", 4000)
    for thread in range(8):
        numbers = [e["payload"]["number"] for e in kyt_listener.events("message") if e["type"] == thread]
        assert numbers == list(range(500))


def test_answers_come_while_other_threads_hold_the_interpreter(kyt_listener):
    stop = threading.Event()

    def spin():
        while not stop.is_set():
            sum(range(1000))

    spinning = threading.Thread(target=spin)
    spinning.start()
    try:
        with kyt.Session(20, batch=True) as session:
            for _ in range(20):
                session.send(1, 1)
                assert session.flush(30) is None
    finally:
        stop.set()
        spinning.join()


def test_closing_from_one_thread_ends_the_waiting_of_another(kyt_listener):
    kyt_listener.stop()  # nobody answers
    session = kyt.Session(20)
    errors = []

    def wait():
        try:
            session.flush()
        except kyt.Error as error:
            errors.append(type(error))

    waiting = [threading.Thread(target=wait) for _ in range(4)]
    for thread in waiting:
        thread.start()
    session.close()
    for thread in waiting:
        thread.join(20)
        assert not thread.is_alive()
    assert errors == [kyt.ClosedError] * 4


def test_a_session_that_nobody_holds_is_closed_and_freed(kyt_listener):
    for _ in range(50):
        session = kyt.Session(20)
        session.send(1, 1)
    del session
    gc.collect()
    kyt_listener.wait_for("end", 1)
    assert kyt.total_statistics().queued == 0
    assert closes(kyt.total_statistics())


def test_a_callback_that_would_wait_for_itself_is_told(kyt_listener):
    errors = []

    def told(state, why):
        try:
            session.flush()
        except (RuntimeError, kyt.Error) as error:
            errors.append(str(error))

    ready = threading.Event()

    def wait_and_tell(state, why):
        ready.wait(10)
        told(state, why)

    session = kyt.Session(20, on_state_change=wait_and_tell)
    ready.set()
    kyt_listener.wait_for("configuration")
    assert eventually(lambda: errors)
    session.finish()
    session.close()
    assert "may not wait" in errors[0]


def test_a_session_without_a_thread_ends_and_its_state_can_be_read(program):
    said = program(
        """
        import os, resource
        import kytreporting as kyt
        if os.getuid() == 0:
            os.setuid(65534)  # the limit is nothing to root
        resource.setrlimit(resource.RLIMIT_NPROC, (0, 0))
        class Watched(kyt.Session):
            def told(self, state, reason):
                print(state.name, self.state.name, reason == self.state_reason)
            def __init__(self):
                super().__init__(20, socket="/nonexistent/socket", on_state_change=self.told)
        Watched().close()
        """
    )
    assert said.splitlines()[0] == "NO_DAEMON NO_DAEMON True"
