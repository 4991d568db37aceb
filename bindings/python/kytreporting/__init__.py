"""Report events to kytreportingd from Python.

    import kytreporting as kyt

    with kyt.Session(client_type=20, client="example", service="demo") as session:
        session.send(10, 1, step=1, duration=0.25)

A session describes the program to the daemon and sends messages: each a category, a type and a payload. Nothing blocks
on the daemon or the network but what says so: messages go into a bounded queue, and one thread of libkytreporting talks
to the daemon. A daemon that is not there, dies or comes back is waited for and told again who the session is. Nothing
is lost without being counted: see Session.statistics().

Every operation may be called from any thread. After os.fork() the child goes on with a session of its own, opened at
its first use. What is queued when the program ends is sent, for a second at most, and so is what a process of
multiprocessing (fork, spawn or forkserver) queued whose function returned; os._exit() and a signal lose what is queued.

The page "Reporting from a program" has the whole story: PROGRAMS.md in the documents of libkytreporting-dev.
"""

from ._aggregation import Aggregated
from ._errors import (
    BackEndError,
    ClosedError,
    Error,
    InvalidError,
    NotConnectedError,
    QueueFullError,
    RefusedError,
    TimedOutError,
)
from ._logging import LoggingHandler
from ._session import Flag, Session, State, asend_single, send_single, total_statistics
from ._statistics import Statistics
from ._timing import Counter, Timer
from ._values import Payload, Scalar

__version__ = "8.0.0"

__all__ = [
    "Aggregated",
    "BackEndError",
    "ClosedError",
    "Counter",
    "Error",
    "Flag",
    "InvalidError",
    "LoggingHandler",
    "NotConnectedError",
    "Payload",
    "QueueFullError",
    "RefusedError",
    "Scalar",
    "Session",
    "State",
    "Statistics",
    "TimedOutError",
    "Timer",
    "asend_single",
    "send_single",
    "total_statistics",
]
