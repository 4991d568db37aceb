"""Log records as messages."""

from __future__ import annotations

import logging
from typing import Any, Callable, Dict, Mapping, Optional

from ._errors import ClosedError, NotConnectedError
from ._session import Session


class LoggingHandler(logging.Handler):
    """Sends each log record as a message of one category; its type is the record's level (10, 20, 30, 40, 50).

        logging.getLogger().addHandler(kyt.LoggingHandler(session, category=30, level=logging.WARNING))

    The payload has logger, level, function and line, and of a record with arguments the unformatted text, which is the
    same for all its records. A text without arguments may have been put together by the program (an f-string, an
    exception) and hold what nobody meant to report: it goes along only with formatted=True, as the formatted message
    does. `payload` makes another one of the record. Never raises and never blocks: what the queue has no room for, and
    what comes after the session's end, is counted in its statistics.
    """

    def __init__(
        self,
        session: Session,
        category: int,
        level: int = logging.WARNING,
        *,
        formatted: bool = False,
        payload: Optional[Callable[[logging.LogRecord], Mapping[str, Any]]] = None,
    ) -> None:
        super().__init__(level)
        self._session = session
        self._category = category
        self._formatted = formatted
        self._payload = payload

    def emit(self, record: logging.LogRecord) -> None:
        """Sends the record."""
        try:
            level = min(max(record.levelno // 10 * 10, logging.DEBUG), logging.CRITICAL)
            self._session.send(self._category, level, self._payload_of(record))
        except (ClosedError, NotConnectedError):
            pass  # a program logs while it ends, too
        except Exception:  # pylint: disable=broad-except  # as handlers do
            self.handleError(record)

    def _payload_of(self, record: logging.LogRecord) -> Mapping[str, Any]:
        if self._payload is not None:
            return self._payload(record)
        payload: Dict[str, Any] = {
            "logger": record.name,
            "level": record.levelname,
            "function": record.funcName,
            "line": record.lineno,
        }
        if record.args and isinstance(record.msg, str):
            payload["text"] = record.msg
        if record.exc_info and record.exc_info[0] is not None:
            payload["exception"] = record.exc_info[0].__name__
        if self._formatted:
            payload["message"] = self.format(record)
        return payload
