import asyncio

import pytest

import kytreporting as kyt


def test_what_is_queued_when_the_program_ends_is_sent(kyt_listener, program):
    program(
        """
        import kytreporting as kyt
        session = kyt.Session(20)
        for number in range(100):
            session.send(1, 1, number=number)
        """
    )
    assert len(kyt_listener.wait_for("message", 100)) == 100
    kyt_listener.wait_for("finish")


def test_a_program_ends_at_once_where_no_daemon_is(program, tmp_path):
    said = program(
        """
        import time
        import kytreporting as kyt
        session = kyt.Session(20)
        session.send(1, 1)
        """,
        KYTREPORTING_SOCKET=str(tmp_path / "none"),
    )
    assert said == ""


def test_no_answer_reaches_an_interpreter_that_has_ended(kyt_listener, program):
    # Calls of every kind are on their way, from a thread that the end does not wait for.
    for _ in range(10):
        program(
            """
            import threading
            import kytreporting as kyt
            from kytreporting import _calls
            session = kyt.Session(20, on_state_change=lambda state, why: None)
            begun = threading.Event()
            def until_the_end(what):
                try:
                    for _ in range(200):
                        what()
                        begun.set()
                except kyt.Error:
                    pass
            def ask():
                session._states(None), session._flush(), session._reply(1, 1, None, {}, 0)
            for what in (ask, lambda: kyt.send_single(1, 1, client_type=20)):
                threading.Thread(target=until_the_end, args=(what,), daemon=True).start()
            begun.wait()
            """
        )


def test_nothing_is_sent_any_more_once_the_program_has_ended(kyt_listener, program):
    # What is registered first runs last: after the module has ended all that it had.
    said = program(
        """
        import atexit
        def late():
            try:
                kyt.send_single(1, 2, client_type=20)
            except kyt.ClosedError as error:
                print(error)
        atexit.register(late)
        import kytreporting as kyt
        kyt.send_single(1, 1, client_type=20)
        """
    )
    assert said == "the program ends\n"
    assert [event["type"] for event in kyt_listener.events("message")] == [1]


def test_an_error_in_a_callback_is_told_and_harms_nobody(kyt_listener, program):
    said = program(
        """
        import sys, threading
        import kytreporting as kyt
        told = threading.Event()
        def unraisable(what):
            print(what.exc_value)
            told.set()
        sys.unraisablehook = unraisable
        def wrong(state, why):
            raise KeyError("mine")
        with kyt.Session(20, on_state_change=wrong) as session:
            assert told.wait(20)
            assert session.configure() == ["httppost"]
        """
    )
    assert "'mine'" in said


def test_nothing_is_opened_when_the_program_has_ended(kyt_listener, program):
    said = program(
        """
        import atexit
        def late():
            try:
                kyt.Session(20)
            except kyt.ClosedError as error:
                print(error)
        atexit.register(late)  # runs after the module's own
        import kytreporting as kyt
        """
    )
    assert said == "the program ends\n"


def test_a_program_that_is_interrupted_as_it_ends_hears_nothing_any_more(kyt_listener, program):
    said = program(
        """
        import atexit
        import kytreporting as kyt
        from kytreporting import _session
        session = kyt.Session(20)
        def interrupted(*arguments):
            raise KeyboardInterrupt
        session.finish = interrupted
        atexit.unregister(_session._at_exit)
        try:
            _session._at_exit()
        except KeyboardInterrupt:
            print("interrupted")
        try:
            kyt.send_single(1, 2, client_type=20)
        except kyt.ClosedError as error:
            print(error)
        """
    )
    assert said == "interrupted\nthe program ends\n"


def test_a_program_that_is_interrupted_twice_as_it_ends_leaves_no_session(program, tmp_path):
    said = program(
        """
        import atexit, os, signal, threading
        import kytreporting as kyt
        from kytreporting import _session
        session = kyt.Session(20)
        session.send(1, 1)
        def interrupted(*arguments):
            raise KeyboardInterrupt
        session.finish = interrupted
        atexit.unregister(_session._at_exit)
        class Opening:  # another thread opens something
            def __enter__(self):
                os.kill(os.getpid(), signal.SIGINT)
                threading.Event().wait(60)
            def __exit__(self, *error):
                pass
        _session._program.opening, opening = Opening(), _session._program.opening
        try:
            _session._at_exit()
        except KeyboardInterrupt:
            print("interrupted", session.statistics().queued, session.statistics().lost_in_queue)
        _session._program.opening = opening
        try:
            kyt.send_single(1, 2, client_type=20)
        except kyt.ClosedError as error:
            print(error)
        """,
        KYTREPORTING_SOCKET=str(tmp_path / "none"),
    )
    assert said == "interrupted 0 1\nthe program ends\n"


def test_ctrl_c_ends_the_waiting_for_an_answer(program, tmp_path):
    said = program(
        """
        import os, signal, sys, threading, time
        import kytreporting as kyt
        from kytreporting import _calls
        session = kyt.Session(20, call_deadline=0)
        main = threading.get_ident()
        def waits():
            frame = sys._current_frames()[main]
            while frame is not None and frame.f_code is not _calls.wait.__code__:
                frame = frame.f_back
            return frame is not None
        def interrupt():
            while not waits():
                time.sleep(0.001)
            os.kill(os.getpid(), signal.SIGINT)
        for wait in (session.flush, session.configure, session.fetch_display_url):
            threading.Thread(target=interrupt).start()
            try:
                wait()
            except KeyboardInterrupt:
                print("interrupted")
        session.close()
        """,
        KYTREPORTING_SOCKET=str(tmp_path / "none"),
    )
    assert said == "interrupted\n" * 3


def test_ctrl_c_while_a_with_statement_ends_leaves_no_session(program, tmp_path):
    said = program(
        """
        import os, signal, sys, threading, time
        import kytreporting as kyt
        class Session(kyt.Session):
            def finish(self, timeout=0.5):
                return super().finish(timeout)
        main = threading.get_ident()
        def finishes():
            frame = sys._current_frames()[main]
            while frame is not None and frame.f_code is not kyt.Session.finish.__code__:
                frame = frame.f_back
            return frame is not None
        def interrupt():
            while not finishes():
                time.sleep(0.001)
            os.kill(os.getpid(), signal.SIGINT)
        try:
            with Session(20, finish_waits_for_daemon=True) as session:
                session.send(1, 1)
                threading.Thread(target=interrupt).start()
        except KeyboardInterrupt:
            print("interrupted", session.statistics().queued, session.statistics().lost_in_queue)
        """,
        KYTREPORTING_SOCKET=str(tmp_path / "none"),
    )
    assert said == "interrupted 0 1\n"


def test_a_task_that_is_cancelled_as_it_ends_leaves_no_session(tmp_path, monkeypatch):
    monkeypatch.setenv("KYTREPORTING_SOCKET", str(tmp_path / "none"))
    sessions = []

    async def report():
        async with kyt.Session(20, finish_waits_for_daemon=True) as session:
            session.send(1, 1)
            sessions.append(session)

    async def end():
        task = asyncio.create_task(report())
        while not sessions or not sessions[0]._ended:
            await asyncio.sleep(0.001)
        task.cancel()
        with pytest.raises(asyncio.CancelledError):
            await task
        return sessions[0].statistics()

    figures = asyncio.run(end())
    assert (figures.queued, figures.lost_in_queue) == (0, 1)


# A daemon that takes connections and says nothing: finish() would wait for its whole time. The interrupt comes when the
# session is marked as ended, and thus within finish().
_SILENT = """
import asyncio, os, signal, socket, sys, threading, time
import kytreporting as kyt
silent = socket.socket(socket.AF_UNIX)
silent.bind(os.environ["KYTREPORTING_SOCKET"])
silent.listen()
session = kyt.Session(20)
session.send(1, 1)
def interrupt(within):
    def when_it_waits():
        while not session._ended:
            time.sleep(0.001)
        os.kill(os.getpid(), signal.SIGINT)
    threading.Thread(target=when_it_waits).start()
    try:
        within()
    except KeyboardInterrupt:
        print("interrupted")
    silent.close()
    print(session.finish(600), session.statistics().lost_in_queue)
    try:
        session.send(1, 1)
    except kyt.ClosedError as error:
        print(error)
"""


def test_ctrl_c_ends_finish_and_the_session_at_once(program, tmp_path):
    said = program(_SILENT + "interrupt(lambda: session.finish(600))", KYTREPORTING_SOCKET=str(tmp_path / "silent"))
    assert said == "interrupted\nFalse 1\nthe session is closed\n"


def test_ctrl_c_ends_the_finish_at_the_end_of_a_with_statement_at_once(program, tmp_path):
    said = program(
        _SILENT
        + """
finish = session.finish
session.finish = lambda timeout=600: finish(timeout)
def within():
    with session:
        pass
interrupt(within)
""",
        KYTREPORTING_SOCKET=str(tmp_path / "silent"),
    )
    assert said == "interrupted\nFalse 1\nthe session is closed\n"


def test_ctrl_c_ends_a_finish_of_asyncio_at_once(program, tmp_path):
    said = program(
        _SILENT + "interrupt(lambda: asyncio.run(session.afinish(600)))", KYTREPORTING_SOCKET=str(tmp_path / "silent")
    )
    assert said == "interrupted\nFalse 1\nthe session is closed\n"


def test_a_handler_that_returns_lets_finish_go_on(kyt_listener, program):
    said = program(
        """
        import os, signal, threading, time
        import kytreporting as kyt
        handled = threading.Event()
        signal.signal(signal.SIGUSR1, lambda number, frame: handled.set())
        session = kyt.Session(20)
        session.send(1, 1)
        def interrupt():
            while not session._ended:
                time.sleep(0.001)
            os.kill(os.getpid(), signal.SIGUSR1)
        thread = threading.Thread(target=interrupt)
        thread.start()
        print(session.finish(600))
        thread.join()
        print(handled.wait(20))
        """
    )
    assert said == "True\nTrue\n"
