import datetime
import enum

import pytest

import kytreporting as kyt


class Step(enum.IntEnum):
    FIRST = 1


class Word(str, enum.Enum):
    ONE = "one"


def sent(listener, payload):
    """The payload as the daemon gets it."""
    before = len(listener.events("message"))
    with kyt.Session(20) as session:
        assert session.send(1, 1, payload)
    return listener.wait_for("message", before + 1)[-1]["payload"]


def test_values_of_each_kind_arrive(kyt_listener):
    moment = datetime.datetime(2026, 11, 22, 12, 0, 0, 250000, tzinfo=datetime.timezone.utc)
    payload = {
        "text": "grüße",
        "empty": "",
        "int": -3,
        "most": 2**63 - 1,
        "least": -(2**63),
        "unsigned": 2**64 - 1,
        "float": 0.25,
        "yes": True,
        "no": False,
        "bytes": b"\x00\xff",
        "bytearray": bytearray(b"\x01"),
        "moment": moment,
        "list": [1, "a", True, 2.5, b"\x02", moment, 2**64 - 1, [1], {"b": 2}],
        "tuple": (1, 2),
        "mapping": {"inner": {"deep": 1}},
        "step": Step.FIRST,
        "word": Word.ONE,
    }
    assert sent(kyt_listener, payload) == {
        "text": "grüße",
        "empty": "",
        "int": -3,
        "most": 2**63 - 1,
        "least": -(2**63),
        "unsigned": 2**64 - 1,
        "float": 0.25,
        "yes": True,
        "no": False,
        "bytes": "00ff",
        "bytearray": "01",
        "moment": moment.timestamp(),
        "list": [1, "a", True, 2.5, "02", moment.timestamp(), 2**64 - 1, [1], {"b": 2}],
        "tuple": [1, 2],
        "mapping": {"inner": {"deep": 1}},
        "step": 1,
        "word": "one",
    }


def test_none_is_left_out(kyt_listener):
    assert sent(kyt_listener, {"a": None, "b": 1, "c": {"d": None}}) == {"b": 1, "c": {}}


def test_a_half_of_a_surrogate_pair_becomes_a_mark(kyt_listener):
    assert sent(kyt_listener, {"a": "x\udc80y"}) == {"a": "x?y"}


def circle():
    made = {}
    made["itself"] = made
    return made


@pytest.mark.parametrize(
    "payload, text",
    [
        ({"a": 2**64}, "64 bits"),
        ({"a": -(2**63) - 1}, "64 bits"),
        ({"a": object()}, "a value of the type object cannot be sent"),
        ({"a": [None]}, "NoneType"),
        ({"a": {1, 2}}, "set"),
        ({1: "a"}, "a key of the type int"),
        ({"a": "x\0y"}, "NUL"),
        ({"a\0b": 1}, "NUL"),
        (circle(), "nested too deeply"),
    ],
)
def test_what_cannot_be_sent_is_refused_and_named(kyt_listener, payload, text):
    with kyt.Session(20) as session:
        with pytest.raises(kyt.InvalidError, match=text):
            session.send(1, 1, payload)
        assert session.statistics().accepted == 0


def test_category_and_type_are_whole_numbers(kyt_listener):
    with kyt.Session(20) as session:
        for category in (-1, 2**32, 2**70, "1", 1.0):
            with pytest.raises(kyt.InvalidError, match="whole numbers"):
                session.send(category, 1)


def test_a_path_with_a_nul_is_refused_not_cut_off(kyt_listener):
    with pytest.raises(kyt.InvalidError, match="NUL"):
        kyt.Session(20, socket=kyt_listener.socket_path + "\0more")
    with kyt.Session(20) as session:
        with pytest.raises(kyt.InvalidError, match="NUL"):
            session.upload_file(__file__ + "\0.txt")
    assert not kyt_listener.events("file")


def test_a_shared_entrys_name_is_taken_back_as_it_was_given(kyt_listener):
    with kyt.Session(20) as session:
        session.update_shared_data({"a\udc80": 1})
        session.remove_shared_data("a\udc80")
    kyt_listener.wait_for("end")
    assert len(kyt_listener.events("sharedData")) == 2


def test_a_date_without_a_moment_is_invalid(kyt_listener):
    with kyt.Session(20) as session:
        with pytest.raises(kyt.InvalidError, match="the date"):
            session.send(1, 1, at=datetime.datetime(1, 1, 1))


@pytest.mark.parametrize("wrong", [-1.0, float("inf"), float("nan"), 5e6])
def test_seconds_that_cannot_be_meant_are_invalid(wrong):
    with pytest.raises(kyt.InvalidError, match="call_deadline"):
        kyt.Session(20, call_deadline=wrong)
    with pytest.raises(kyt.InvalidError, match="flush_interval"):
        kyt.Session(20, flush_interval=wrong)


def test_a_negative_bound_is_invalid():
    with pytest.raises(kyt.InvalidError, match="bound"):
        kyt.Session(20, max_queued_messages=-1)


def test_a_deadline_below_a_millisecond_is_a_deadline(tmp_path):
    session = kyt.Session(20, socket=str(tmp_path / "none"), call_deadline=0.0005)
    with pytest.raises(kyt.TimedOutError, match="no daemon within"):
        session.flush(timeout=20)
    session.close()


@pytest.mark.parametrize(
    "call, text",
    [
        (lambda session: session.send(1, 1, [1]), "payload must be a mapping, not a value of the type list"),
        (lambda session: session.send(1, 1, 5, a=1), "payload must be a mapping, not a value of the type int"),
        (lambda session: session.send(1, 1, a=10**5000), "a number of 16610 bits: whole numbers have 64 bits"),
        (lambda session: session.send(1, 1, flag="x"), "flag must be a whole number"),
        (lambda session: session.send(1, 1, flag=2**40), "flag must be from 0 to 3"),
        (lambda session: session.send_with_reply(1, 1, flag=-1), "flag must be from 0 to 3"),
        (lambda session: session.upload_log_data("text"), "log_data must be a list"),
        (lambda session: session.update_shared_data([1]), "entries must be a mapping"),
        (lambda session: session.remove_shared_data(5), "a key of the type int"),
        (lambda session: session.set_digest_key("x"), "key must be bytes"),
        (lambda session: session.set_digest_key(b"x", 2**40), "algorithm must be from"),
        (lambda session: session.fetch_states([1]), "user_info must be a mapping"),
        (lambda session: session.send(10**5000, 1), "category a number of 16610 bits, type 1: both are whole"),
        (lambda session: session.send_with_reply(1, 1, timeout="1"), "timeout must be a number of seconds"),
        (lambda session: session.send_with_reply(1, 1, timeout=float("nan")), "timeout must be a number of seconds"),
        (lambda session: session.flush(timeout="1"), "timeout must be a number of seconds"),
        (lambda session: session.finish(None), "timeout must be a number of seconds"),
        (lambda session: session.timed("x", 1), "category and type are whole numbers"),
        (lambda session: session.timed(10**5000, 1), "category a number of 16610 bits and type 1: both are 0 to"),
        (lambda session: session.counter(1, 1, interval="x"), "interval must be a number"),
    ],
)
def test_an_argument_of_a_wrong_type_is_named(kyt_listener, call, text):
    with kyt.Session(20) as session:
        with pytest.raises(kyt.InvalidError, match=text):
            call(session)
        assert session.statistics().accepted == 0


@pytest.mark.parametrize(
    "arguments, text",
    [
        ({"client_type": None}, '"ClientType" is None'),
        ({"require_user_info": None}, '"RequireUserInfo" is None'),
        ({"batch": None}, '"BatchEvent" is None'),
        ({"client": 5}, "client must be a text, not a value of the type int"),
        ({"service": b"x"}, "service must be a text, not a value of the type bytes"),
        ({"user_info": [1]}, "user_info must be a mapping"),
        ({"hierarchy": "x"}, "hierarchy must be a token and a level"),
        ({"hierarchy": ("token", None)}, "hierarchy must be a token and a level, neither of them None"),
        ({"hierarchy": (None, 0)}, "hierarchy must be a token and a level, neither of them None"),
        ({"finish_waits_for_daemon": "no"}, "finish_waits_for_daemon must be a boolean, not a value of the type str"),
        ({"wait_for_daemon": None}, "wait_for_daemon must be a boolean"),
        ({"configure": None}, "configure must be a boolean"),
        ({"on_state_change": 5}, "on_state_change must be a function"),
        ({"on_aggregated": "x"}, "on_aggregated must be a function"),
        ({"max_queued_messages": 64.5}, "max_queued_messages must be a whole number"),
        ({"call_deadline": "x"}, "call_deadline must be a number of seconds"),
        ({"flush_interval": None}, "flush_interval must be a number of seconds"),
        ({"call_deadline": 10**5000}, "call_deadline: a number of 16610 bits is no number of seconds from"),
    ],
)
def test_a_session_names_its_argument_of_a_wrong_type(arguments, text):
    with pytest.raises(kyt.InvalidError, match=text):
        kyt.Session(**{"client_type": 20, **arguments})


@pytest.mark.parametrize("timeout", [1e300, float("inf"), 10**400])
def test_a_timeout_may_be_longer_than_a_thread_can_wait(kyt_listener, timeout):
    with kyt.Session(20) as session:
        assert session.send_with_reply(1, 1, timeout=timeout) is None


def test_user_information_that_cannot_be_sent_changes_nothing(kyt_listener):
    with kyt.Session(20, "x") as session:
        for wrong in ({1: 2}, {"a": object()}):
            with pytest.raises(kyt.InvalidError):
                session.fetch_states(wrong)
        assert session.fetch_states() == ["httppost"]
    kyt_listener.wait_for("end")
    assert [told["userInfo"] for told in kyt_listener.events("states")] == [{"ClientName": "x"}]
