import json
import subprocess
import sys

import pytest

from conftest import eventually


def test_a_child_goes_on_with_a_session_of_its_own(kyt_listener, program):
    said = program(
        """
        import json, os
        import kytreporting as kyt
        session = kyt.Session(20, "x", session_id=5)
        session.update_shared_data(kind="call")
        session.send(1, 1)
        assert session.configure() == ["httppost"]
        child = os.fork()
        if child == 0:
            assert session.statistics().accepted == 0
            session.send(1, 2)
            finished = session.finish()
            print(json.dumps([finished, session.statistics().sent]), flush=True)
            os._exit(0)
        os.waitpid(child, 0)
        session.send(1, 3)
        print(json.dumps([session.finish(), session.statistics().sent]))
        """
    )
    assert [json.loads(line) for line in said.splitlines()] == [[True, 1], [True, 2]]
    assert [event["sessionInfo"]["SessionID"] for event in kyt_listener.events("session")] == [5, 5]
    assert sorted((e["connection"], e["type"]) for e in kyt_listener.wait_for("message", 3)) == [(1, 1), (1, 3), (2, 2)]
    assert len(kyt_listener.events("sharedData")) == 2


def test_a_child_that_does_not_report_opens_nothing(kyt_listener, program):
    program(
        """
        import os
        import kytreporting as kyt
        with kyt.Session(20) as session:
            session.configure()
            if os.fork() == 0:
                session.finish()
                os._exit(0)
            os.wait()
        """
    )
    kyt_listener.wait_for("end")
    assert len(kyt_listener.events("session")) == 1


def test_a_sum_of_a_child_leaves_at_its_end(kyt_listener, program):
    program(
        """
        import os, sys
        import kytreporting as kyt
        session = kyt.Session(20)
        counter = session.counter(21, 1, interval=3600)
        child = os.fork()
        if child == 0:
            counter.add(5)
            os._exit(0 if session.finish() else 1)
        assert os.waitpid(child, 0)[1] == 0
        """
    )
    assert kyt_listener.wait_for("message")[0]["payload"]["count"] == 5


def test_forks_beside_busy_threads_harm_nobody(kyt_listener, program):
    said = program(
        """
        import os, threading
        import kytreporting as kyt
        session = kyt.Session(20, max_queued_messages=65536)
        stop = threading.Event()
        def report():
            while not stop.is_set():
                session.send(1, 1)
        def ask():
            while not stop.is_set():
                session.fetch_states()
        threads = [threading.Thread(target=what) for what in (report, ask)]
        for thread in threads:
            thread.start()
        for number in range(20):
            child = os.fork()
            if child == 0:
                session.send(1, 2)
                status = 0 if session.finish(20) and session.statistics().sent == 1 else 1
                os._exit(status)
            assert os.waitpid(child, 0)[1] == 0, number
        stop.set()
        for thread in threads:
            thread.join()
        assert session.finish(20)
        figures = session.statistics()
        assert figures.accepted == figures.sent + figures.queued + figures.dropped
        print(figures.sent)
        """
    )
    messages = kyt_listener.wait_for("message", int(said) + 20)
    assert sum(message["type"] == 2 for message in messages) == 20
    assert sum(message["type"] == 1 for message in messages) == int(said)


def test_a_session_that_was_closed_before_the_fork_stays_closed(kyt_listener, program):
    said = program(
        """
        import os
        import kytreporting as kyt
        session = kyt.Session(20)
        session.finish()
        if os.fork() == 0:
            try:
                session.send(1, 1)
            except kyt.ClosedError as error:
                print(error, flush=True)
            os._exit(0)
        os.wait()
        """
    )
    assert said == "the session is closed\n"
    assert eventually(lambda: len(kyt_listener.events("end")) == 1)


def test_a_child_that_only_looks_opens_nothing(kyt_listener, program):
    said = program(
        """
        import os
        import kytreporting as kyt
        with kyt.Session(20) as session:
            session.configure()
            if os.fork() == 0:
                print(session.statistics().accepted, session.state.name, session.state_reason, flush=True)
                os._exit(0)
            os.wait()
        """
    )
    assert said == "0 NO_DAEMON nothing was sent from this forked process yet\n"
    kyt_listener.wait_for("end")
    assert len(kyt_listener.events("session")) == 1


def test_a_child_has_a_random_session_id_of_its_own(kyt_listener, program):
    program(
        """
        import os
        import kytreporting as kyt
        with kyt.Session(20) as session:
            session.configure()
            if os.fork() == 0:
                session.send(1, 1)
                session.finish()
                os._exit(0)
            os.wait()
        """
    )
    kyt_listener.wait_for("end", 2)
    first, second = kyt_listener.events("session")
    assert first["sessionInfo"]["SessionID"] != second["sessionInfo"]["SessionID"]


@pytest.mark.parametrize("method", ["fork", "spawn", "forkserver"])
def test_what_a_process_of_multiprocessing_queued_is_sent_at_its_end(kyt_listener, tmp_path, method):
    path = tmp_path / "report.py"
    path.write_text(
        "import multiprocessing, sys\n"
        "import kytreporting as kyt\n"
        "session = kyt.Session(20)\n"
        "counter = session.counter(2, 1, interval=3600)\n"
        "def work(number):\n"
        "    session.send(1, number)\n"
        "    counter.add(3)\n"
        "if __name__ == '__main__':\n"
        f"    context = multiprocessing.get_context('{method}')\n"
        "    processes = [context.Process(target=work, args=(number,)) for number in range(3)]\n"
        "    for process in processes:\n"
        "        process.start()\n"
        "    for process in processes:\n"
        "        process.join()\n"
    )
    subprocess.run([sys.executable, str(path)], check=True, timeout=60)
    messages = kyt_listener.wait_for("message", 6)
    assert sorted((m["category"], m["type"]) for m in messages) == [(1, 0), (1, 1), (1, 2), (2, 1), (2, 1), (2, 1)]


def test_a_sum_alone_leaves_with_a_process_of_multiprocessing(kyt_listener, program):
    program(
        """
        import multiprocessing
        import kytreporting as kyt
        session = kyt.Session(20)
        counter = session.counter(2, 1, interval=3600)
        process = multiprocessing.get_context("fork").Process(target=counter.add)
        process.start()
        process.join()
        """
    )
    assert kyt_listener.wait_for("message")[0]["payload"]["count"] == 1


@pytest.mark.parametrize("method", ["fork", "spawn", "forkserver"])
def test_a_pool_that_is_closed_and_joined_sends_all(kyt_listener, tmp_path, method):
    path = tmp_path / "report.py"
    path.write_text(
        "import multiprocessing\n"
        "import kytreporting as kyt\n"
        "session = kyt.Session(20)\n"
        "def work(number):\n"
        "    session.send(1, number)\n"
        "if __name__ == '__main__':\n"
        f"    pool = multiprocessing.get_context('{method}').Pool(2)\n"
        "    pool.map(work, range(50))\n"
        "    pool.close()\n"
        "    pool.join()\n"
    )
    subprocess.run([sys.executable, str(path)], check=True, timeout=60)
    assert sorted(m["type"] for m in kyt_listener.wait_for("message", 50)) == list(range(50))


def test_what_a_child_queued_before_os_exit_is_lost_unless_it_finishes(kyt_listener, program):
    kyt_listener.stop()  # what is queued cannot leave before the child has ended
    said = program(
        """
        import os
        import kytreporting as kyt
        session = kyt.Session(20)
        for finishes in (False, True):
            child = os.fork()
            if child == 0:
                session.send(1, 1)
                if finishes:
                    print(session.finish(), session.statistics().lost_in_queue, flush=True)
                os._exit(0)
            os.waitpid(child, 0)
        """
    )
    assert said == "False 1\n"
    kyt_listener.start()
    assert not kyt_listener.events("message")
