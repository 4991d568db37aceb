import asyncio

import pytest
from conftest import closes, eventually

import kytreporting as kyt
from kytreporting.testing import Listener


def test_a_session_tells_who_it_is_and_reports(kyt_listener):
    with kyt.Session(client_type=20, client="x", service="y", session_id=7, client_version=3, batch=True) as session:
        assert session.send(10, 1, step=1)
        assert session.send(10, 2, {"flag": 1}, flag=kyt.Flag.REALTIME | kyt.Flag.EXPEDITE, step=2)
    events = kyt_listener.wait_for("end")
    session_event, *_ = kyt_listener.events("session")
    assert session_event["sessionInfo"] == {
        "SessionID": 7,
        "ClientType": 20,
        "ClientVersion": 3,
        "BatchEvent": True,
        "RequireUserInfo": True,
    }
    assert session_event["userInfo"] == {"ClientName": "x", "ServiceName": "y"}
    first, second = kyt_listener.events("message")
    assert (first["category"], first["type"], first["flag"], first["payload"]) == (10, 1, 0, {"step": 1})
    assert (second["flag"], second["payload"]) == (3, {"flag": 1, "step": 2})
    assert [event["event"] for event in kyt_listener.events()] == [
        "session", "configuration", "message", "message", "finish", "end",
    ]
    assert len(events) == 1


def test_answers_come_back(kyt_listener):
    with kyt.Session(20, "x", batch=True) as session:
        assert session.configure() == ["httppost"]
        assert session.state is kyt.State.LIVE
        assert session.state_reason == "httppost"
        assert session.fetch_states({"ClientName": "z"}) == ["httppost"]
        assert session.fetch_display_url() == "URL not available"
        assert session.send_with_reply(1, 2, a=1) is None
        assert session.flush() is None
        assert not session.upload_log_data(["line", 2, {"a": [1.5]}])  # no back end for it
        assert not session.upload_file(__file__)
    kyt_listener.wait_for("end")
    assert kyt_listener.events("states")[0]["userInfo"] == {"ClientName": "z"}
    assert kyt_listener.events("logData")[0]["logData"] == ["line", 2, {"a": [1.5]}]


def test_the_back_end_for_files_takes_files_and_log_data(monkeypatch):
    with Listener(live="httppost,uploadserver") as listener:
        monkeypatch.setenv("KYTREPORTING_SOCKET", listener.socket_path)
        with kyt.Session(20) as session:
            assert session.upload_log_data(["line"])
            assert session.upload_file(__file__)


def test_errors_have_the_librarys_texts(kyt_listener):
    with pytest.raises(kyt.InvalidError, match="ClientType"):
        kyt.Session(client_type=99)
    session = kyt.Session(20)
    with pytest.raises(kyt.BackEndError, match="^Nothing to flush$"):
        session.flush()
    with pytest.raises(kyt.InvalidError, match="^category 70000, type 1: both are whole numbers from 0 to 65535$"):
        session.send(70000, 1)
    with pytest.raises(kyt.InvalidError, match="/nonexistent/file"):
        session.upload_file("/nonexistent/file")
    session.finish()
    with pytest.raises(kyt.ClosedError, match="^the session is closed$"):
        session.send(1, 1)
    with pytest.raises(kyt.ClosedError):
        session.flush()
    assert session.statistics().dropped_invalid == 1
    assert session.statistics().dropped_closed == 1


def test_without_a_daemon_calls_time_out_and_messages_wait(tmp_path):
    session = kyt.Session(20, socket=str(tmp_path / "none"), call_deadline=0.05)
    assert session.send(1, 1)
    with pytest.raises(kyt.TimedOutError, match="no daemon within 0.05 s"):
        session.flush()
    assert session.state is kyt.State.NO_DAEMON
    assert str(tmp_path / "none") in session.state_reason
    figures = session.statistics()
    assert figures.queued == 1 and closes(figures)
    assert not session.finish()
    assert session.statistics().lost_in_queue == 1


def test_a_callers_time_is_kept(tmp_path):
    session = kyt.Session(20, socket=str(tmp_path / "none"))
    with pytest.raises(kyt.TimedOutError, match="no answer within 0.02 s"):
        session.flush(timeout=0.02)
    session.close()


def test_a_full_queue_refuses_and_counts(tmp_path):
    session = kyt.Session(20, socket=str(tmp_path / "none"), max_queued_messages=64)
    sent = [session.send(1, 1) for _ in range(100)]
    assert sent.count(True) <= 64 and not sent[-1]
    figures = session.statistics()
    assert figures.dropped_queue_full == sent.count(False)
    assert figures.accepted == figures.queued == sent.count(True)
    session.close()


def test_states_are_told_with_their_reasons(kyt_listener):
    told = []
    with kyt.Session(20, on_state_change=lambda state, why: told.append((state, why))):
        assert eventually(lambda: (kyt.State.LIVE, "httppost") in told)
    assert told[0][0] is kyt.State.CONNECTED


def test_a_daemon_that_has_no_storebag_or_refuses_is_told():
    with Listener(storebag=False) as listener:
        with kyt.Session(20, socket=listener.socket_path) as session:
            assert session.configure() is None
            assert session.state is kyt.State.NO_STOREBAG
    with Listener(refuse=True) as listener:
        session = kyt.Session(20, socket=listener.socket_path)
        assert eventually(lambda: session.state is kyt.State.REFUSED)
        session.close()


def test_a_session_outlives_the_daemon(kyt_listener):
    session = kyt.Session(20, "x")
    session.update_shared_data(kind="call")
    session.set_digest_key(b"\x01\xff")
    assert session.send(1, 1)
    kyt_listener.wait_for("message")
    kyt_listener.stop()
    assert eventually(lambda: session.state is kyt.State.NO_DAEMON)
    assert session.send(1, 2)
    kyt_listener.start()
    kyt_listener.wait_for("message", 2)
    assert session.finish()
    kyt_listener.wait_for("finish")
    assert [event["event"] for event in kyt_listener.events()].count("configuration") == 2
    assert kyt_listener.events("digestKey")[-1]["key"] == "01ff"
    assert kyt_listener.events("sharedData")[-1]["entries"] == {"kind": "call"}
    assert closes(session.statistics())


def test_asyncio_waits_without_blocking_the_loop(kyt_listener):
    async def main():
        ticks = 0

        async def tick():
            nonlocal ticks
            while True:
                ticks += 1
                await asyncio.sleep(0)

        ticking = asyncio.create_task(tick())
        async with kyt.Session(20, batch=True) as session:
            assert await session.afetch_states() == ["httppost"]
            session.send(1, 1)
            before = ticks
            assert await session.aflush() is None
            assert ticks > before
            with pytest.raises(kyt.BackEndError, match="Nothing to flush"):
                await session.aflush()
            assert await session.asend_with_reply(1, 2) is None
            assert await session.aconfigure() == ["httppost"]
            assert await session.afetch_display_url() == "URL not available"
            assert not await session.aupload_file(__file__)  # no back end for it
            assert not await session.aupload_log_data(["line"])
            assert await kyt.asend_single(1, 2, client_type=20, client="x", a=1) == "finished"
            before = ticks
            assert await session.afinish()
            assert ticks > before
        ticking.cancel()

    asyncio.run(main())


def test_a_single_message_needs_no_session(kyt_listener):
    assert kyt.send_single(1, 2, client_type=20, client="x", a=1) == "finished"
    [message] = kyt_listener.wait_for("message")
    assert message["sessionInfo"]["ClientType"] == 20 and message["payload"] == {"a": 1}
    with pytest.raises(kyt.InvalidError, match="70000"):
        kyt.send_single(70000, 2, client_type=20)


def test_a_session_in_a_hierarchy_says_its_place(kyt_listener):
    with kyt.Session(20, hierarchy=("9b2f", 1)):
        [session] = kyt_listener.wait_for("session")
    assert session["sessionInfo"]["HierarchyToken"] == {"TokenID": "9b2f", "Level": 1}


def test_totals_are_those_of_all_sessions(kyt_listener):
    before = kyt.total_statistics().accepted
    for _ in range(3):
        with kyt.Session(20) as session:
            session.send(1, 1)
    assert kyt.total_statistics().accepted == before + 3
    assert closes(kyt.total_statistics())


def test_an_interval_flushes_what_was_sent(kyt_listener):
    with kyt.Session(20, flush_interval=0.01) as session:
        session.send(1, 1)
        kyt_listener.wait_for("flush")
        session.send(1, 2)
        kyt_listener.wait_for("flush", 2)
    kyt_listener.wait_for("end")
    assert [event["event"] for event in kyt_listener.events()].count("flush") == 2


def test_a_session_that_does_not_wait_for_a_daemon_ends_without_one(tmp_path):
    session = kyt.Session(20, socket=str(tmp_path / "none"), wait_for_daemon=False)

    def refused():
        try:
            return not session.send(1, 1)
        except kyt.NotConnectedError as error:
            return str(tmp_path / "none") in str(error)

    assert eventually(refused)
    figures = session.statistics()
    assert closes(figures) and figures.queued == 0
