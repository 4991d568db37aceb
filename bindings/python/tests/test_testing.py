import pathlib

import pytest
from conftest import eventually

import kytreporting as kyt
from kytreporting.testing import Listener


def test_a_listener_dies_after_so_many_messages():
    with Listener(die_after=2) as listener:
        session = kyt.Session(20, socket=listener.socket_path)
        for number in range(2):
            session.send(1, number)
        assert eventually(lambda: not listener.is_running)
        assert [event["type"] for event in listener.wait_for("message", 2)] == [0, 1]
        session.close()


def test_a_listener_names_what_did_not_come():
    with Listener() as listener:
        with pytest.raises(TimeoutError, match="0 of 1 events message came within 0.01 s"):
            listener.wait_for("message", timeout=0.01)


def test_a_listener_says_that_it_cannot_listen(tmp_path, capfd):
    with pytest.raises(RuntimeError, match="status 1"):
        Listener(str(tmp_path / "missing" / "socket")).start()
    assert "kytctl: " in capfd.readouterr().err


def test_a_listener_says_that_a_back_end_is_misspelt(capfd):
    with pytest.raises(RuntimeError, match="status 2"):
        Listener(live="htttppost").start()
    assert 'there is no back end "htttppost"; there are httppost, ' in capfd.readouterr().err


def test_every_text_comes_back_as_it_was(kyt_listener):
    texts = ["a\u2028b", "\x7f", "\x85", "\u202e", "\u2066", "tab\tline\n", 'quote " and \\', "\U0001f600", "\x01"]
    with kyt.Session(20) as session:
        for text in texts:
            session.send(1, 1, text=text)
    assert [message["payload"]["text"] for message in kyt_listener.wait_for("message", len(texts))] == texts


def test_a_listener_that_cannot_start_leaves_no_folder(tmp_path, monkeypatch):
    monkeypatch.setattr("tempfile.tempdir", str(tmp_path))
    with pytest.raises(FileNotFoundError):
        with Listener(kytctl=str(tmp_path / "none")):
            pass
    assert not list(tmp_path.iterdir())


def test_the_guides_test_runs(kyt_listener):
    guide = pathlib.Path(__file__).parents[3] / "docs" / "PROGRAMS.md"
    block = guide.read_text(encoding="utf-8").split("```python example=pytest\n")[1].split("```")[0]

    def run_the_program():
        with kyt.Session(20) as session:
            session.send(10, 1, step=1)

    made = {"run_the_program": run_the_program}
    exec(block, made)
    made["test_reports_its_start"](kyt_listener)
