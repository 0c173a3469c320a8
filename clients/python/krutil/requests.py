"""A request from its beginning to its reply, as whoever made it sees it."""

import contextlib
import enum
import threading
import time
from collections import defaultdict
from concurrent.futures import Future
from dataclasses import dataclass, field
from typing import TYPE_CHECKING, Any, Callable, Generic, Iterator, NamedTuple, Optional, TypeVar, Union

from .displays import Display, DisplayLine
from .errors import RemoteFrame

if TYPE_CHECKING:
    from .session import Session

T = TypeVar("T")
OnText = Callable[[str], object]


class Text(str):
    """Text that code wrote: a `str` that knows its stream.

    >>> with krutil.start() as session:
    ...     for text in session.submit("import sys; print('no', file=sys.stderr)").events():
    ...         if isinstance(text, krutil.Text):
    ...             print(repr(text), text.stream)
    'no\\n' error
    """

    #: "output", "error", or "background" for what C libraries and child processes of the engine wrote meanwhile.
    stream: str

    def __new__(cls, text: str, stream: str) -> "Text":
        made = super().__new__(cls, text)
        made.stream = stream
        return made

    def __reduce__(self) -> Any:
        return Text, (str(self), self.stream)


class Value(str):
    """The text of the value of a trailing expression, or a part of it."""


class State(str):
    """A state that the request has reached: "started", "suspended", "resumed", "discarded", "requeued", "reactivated",
    "completed" or "last"."""


class Warned(NamedTuple):
    """A warning that the code caused and that no filter hides."""

    #: The category, such as "DeprecationWarning".
    identifier: str
    message: str
    #: From the outermost frame to the innermost, which is the place that the warning is about.
    frames: tuple[RemoteFrame, ...]


Event = Union[Text, Value, State, Warned, DisplayLine, Display]


class CancelAnswer(enum.Enum):
    """What the engine says to a cancel."""

    #: The request had ended already, or the engine does not know it.
    ALREADY_DONE = 0
    #: The request runs, and is left alone.
    ALREADY_RUNNING = 1
    #: The request had not begun, and will not.
    CANCELLED = 2
    #: The request runs, and is being interrupted. Its reply tells whether that came in time.
    PENDING = 3


@dataclass(frozen=True)
class Result:
    """What came of an evaluation."""

    #: All that was written, to whichever stream.
    output: str
    #: The value of a trailing expression as text; None without one, and for the value None.
    value: Optional[str]
    warnings: tuple[Warned, ...]
    #: Pictures and other forms of values; none without `on_display`.
    displays: tuple[Display, ...] = field(default=(), repr=False)


class _Outcome(Future[T]):
    """Is not cancelled by itself: what becomes of a request, the engine says."""

    def cancel(self) -> bool:
        return False


# Held while listeners come or go. An iterator over events may end anywhere, also in a thread that holds it already.
_listeners_lock = threading.RLock()


class Request(Generic[T]):
    """A request that the engine was given, and what comes of it: a future.

    Any thread may use it.

    >>> with krutil.start() as session:
    ...     request = session.submit("6 * 7")
    ...     request.result(timeout=60).value
    '42'
    """

    def __init__(self, session: "Session", identifier: tuple[int, int],
                 make_result: Callable[["Request[T]", Any], T]) -> None:
        self._session = session
        self._identifier = identifier
        self._make_result = make_result
        self._future: "Future[T]" = _Outcome()
        # Only the thread that reads appends to these; any thread may look at them meanwhile.
        self._events: list[Event] = []
        self._by_kind: "defaultdict[type, list[Any]]" = defaultdict(list)
        # Replaced as a whole, so that whoever calls them needs no lock.
        self._listeners: tuple[Callable[[], object], ...] = ()
        # Where the events begin that have come since the last prompt was closed.
        self._resumed = 0
        self._error_text = ""

    def result(self, timeout: Optional[float] = None) -> T:
        """Waits for the reply: the result of an evaluation, or what the function returned.

        Raises `RemoteError`, `Cancelled`, `Refused`, `Aborted` or `Lost`, and `TimeoutError` when there is no reply
        within the timeout, in seconds. The request goes on then.
        """
        try:
            error = self._future.exception(timeout)
        except TimeoutError:
            raise TimeoutError("there is no reply yet") from None
        if error is not None:
            raise error
        return self._future.result()

    def done(self) -> bool:
        """Whether there is a reply, or never will be one."""
        return self._future.done()

    def add_done_callback(self, function: Callable[["Request[T]"], object]) -> None:
        """Has the function called with this request when it is done: at once, or in the thread that reads."""
        self._future.add_done_callback(lambda _: function(self))

    def cancel(self, even_if_running: bool = True, timeout: Optional[float] = None) -> CancelAnswer:
        """Asks the engine to cancel the request, and returns its answer.

        >>> with krutil.start() as session:
        ...     request = session.submit("while True: pass")
        ...     for event in request.events():
        ...         if event == "started":
        ...             print(request.cancel())
        CancelAnswer.PENDING
        """
        return self.submit_cancel(even_if_running).result(timeout)

    def submit_cancel(self, even_if_running: bool = True) -> "Future[CancelAnswer]":
        """As `cancel()`, without waiting for the answer."""
        return self._session._submit_cancel(self._identifier, even_if_running)

    def events(self, timeout: Optional[float] = None) -> Iterator[Event]:
        """What happens, as it happens: `Text`, `Value`, `Warned`, `State`, `DisplayLine` and `Display`, up to the end.

        Each call begins at the first event. Raises `TimeoutError` if the reply has not come within the timeout, in
        seconds from the first step. What the reply says is left to `result()`.
        """
        end = None if timeout is None else time.monotonic() + timeout
        changed = threading.Event()
        position = 0
        with self._listening(changed.set):
            while True:
                changed.clear()
                # In this order: what comes before the reply is there once the reply is.
                done = self.done()
                arrived = self._so_far(position)
                position += len(arrived)
                yield from arrived
                if done:
                    return
                if not arrived and not changed.wait(None if end is None else end - time.monotonic()):
                    raise TimeoutError("there is no reply yet")

    @property
    def output(self) -> str:
        """What the code has written so far."""
        return "".join(self._by_kind[Text])

    @property
    def value(self) -> Optional[str]:
        """The value of a trailing expression as text, if there is one."""
        # What is shown before a prompt is where the code stands; its value comes at its end.
        # A line that stands for no display is the text of a value that looks like one.
        displayed = [display.number for display in self._by_kind[Display]]
        shown = "".join([event for event in self._events[self._resumed:] if isinstance(event, Value)
                         or (isinstance(event, DisplayLine) and event.number not in displayed)])
        return shown[:-1] if shown.endswith("\n") else shown or None

    @property
    def warnings(self) -> tuple[Warned, ...]:
        """The warnings so far."""
        return tuple(self._by_kind[Warned])

    @property
    def displays(self) -> tuple[Display, ...]:
        """The pictures and other forms of values that have come so far; they come at the end."""
        return tuple(self._by_kind[Display])

    def _so_far(self, position: int = 0) -> list[Event]:
        return self._events[position:]

    @contextlib.contextmanager
    def _listening(self, listener: Callable[[], object]) -> Iterator[None]:
        """Has the listener called whenever there is more to see, in the thread that reads; it must not wait or fail."""
        with _listeners_lock:
            self._listeners += (listener,)
        try:
            yield
        finally:
            with _listeners_lock:
                self._listeners = tuple(each for each in self._listeners if each is not listener)

    # For the thread that reads:

    def _prompted(self) -> tuple[str, str]:
        """At a prompt that has just opened: the line that was begun, and what the engine has shown."""
        events = self._so_far(self._resumed)
        text = "".join(event for event in events if isinstance(event, Text))
        return text.rpartition("\n")[2], "".join(event for event in events if isinstance(event, Value))

    def _add(self, event: Event) -> None:
        self._events.append(event)
        self._by_kind[type(event)].append(event)
        if isinstance(event, State) and event == "resumed":
            self._resumed = len(self._events)
        for listener in self._listeners:
            listener()

    def _finish(self, error: Optional[BaseException], answer: Any = None) -> None:
        """Ends the request, with an error or with what the reply brought."""
        try:
            result = None if error else self._make_result(self, answer)
        except Exception as unusable:
            error = unusable
        if error:
            self._future.set_exception(error)
        else:
            self._future.set_result(result)  # type: ignore[arg-type]
        for listener in self._listeners:
            listener()
