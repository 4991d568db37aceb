import logging

import kytreporting as kyt


def logger_of(handler):
    logger = logging.Logger("service.part")
    logger.addHandler(handler)
    return logger


def test_records_from_a_level_on_are_messages(kyt_listener):
    with kyt.Session(20) as session:
        logger = logger_of(kyt.LoggingHandler(session, 30))
        logger.info("nothing")
        logger.warning("disk %s is full", "secret")
        try:
            raise OSError("x")
        except OSError:
            logger.exception("failed")
    first, second = kyt_listener.wait_for("message", 2)
    assert (first["category"], first["type"]) == (30, 30)
    line = first["payload"].pop("line")
    assert line > 0
    assert first["payload"] == {
        "logger": "service.part",
        "level": "WARNING",
        "function": "test_records_from_a_level_on_are_messages",
        "text": "disk %s is full",
    }
    assert second["type"] == 40 and second["payload"]["exception"] == "OSError"


def test_a_text_that_the_program_put_together_stays_where_it_is(kyt_listener):
    with kyt.Session(20) as session:
        logger = logger_of(kyt.LoggingHandler(session, 30))
        logger.warning(f"login of {'anna@example.org'} failed")
        logger.error(ValueError("for anna@example.org"))
    for message in kyt_listener.wait_for("message", 2):
        assert "text" not in message["payload"] and "anna" not in str(message["payload"])


def test_what_was_formatted_goes_along_when_wanted(kyt_listener):
    with kyt.Session(20) as session:
        logger = logger_of(kyt.LoggingHandler(session, 30, logging.DEBUG, formatted=True))
        logger.debug("disk %s", 1)
        logger = logger_of(kyt.LoggingHandler(session, 31, payload=lambda record: {"mine": record.levelno}))
        logger.log(55, "x")
    first, second = kyt_listener.wait_for("message", 2)
    assert first["type"] == 10 and first["payload"]["message"] == "disk 1"
    assert (second["type"], second["payload"]) == (50, {"mine": 55})


def test_a_closed_session_is_no_error_of_who_logs(kyt_listener, monkeypatch):
    monkeypatch.setattr(logging, "raiseExceptions", False)
    session = kyt.Session(20)
    session.close()
    logger_of(kyt.LoggingHandler(session, 30)).warning("x")
    assert session.statistics().dropped_closed == 1


def test_a_record_after_the_sessions_end_prints_nothing(kyt_listener, capsys):
    session = kyt.Session(20)
    logger = logging.Logger("late")
    logger.addHandler(kyt.LoggingHandler(session, category=30))
    session.finish()
    logger.warning("while %s", "ending")
    assert capsys.readouterr().err == ""
    assert session.statistics().dropped_closed == 1
