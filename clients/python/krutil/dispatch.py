"""The thread that reads: it takes every message at once, and hands it to the request that it belongs to."""

import itertools
import socket
import subprocess
import sys
import threading
from concurrent.futures import Future
from typing import TYPE_CHECKING, Any, Callable, Iterable, Optional, TypeVar, Union

from .arrays import take_value
from .displays import DisplayLine, OnDisplay, displays_from
from .errors import Aborted, Error, Lost, as_text, error_from, remote_frames
from .handshake import Settled, how_it_ended
from .prompts import KINDS, OnDebug, OnInput, Prompt
from .requests import CancelAnswer, OnText, Request, State, Text, Value, Warned
from .schema import (DebugLoopEvent, FEvalResult, IIPCancelReply, IIPReply, IIPResult, IssuedEnabledWarningEvent,
                     PrintableErrorEvent, SinkTextEvent, TextBaseEvent)
from .shared import Borrower, Lender
from .wire import (EndOfStream, Frame, Limits, Message, PeerAborted, Reader, Violation, abort_bytes, goodbye_bytes,
                   message_bytes, read_message, return_bytes)
from .writer import Writer

if TYPE_CHECKING:
    from .session import Session

Exchange = Union[Request[Any], "Future[CancelAnswer]"]
E = TypeVar("E", Request[Any], "Future[CancelAnswer]")

_REPLY, _CANCEL_REPLY, _SHUTDOWN = "krutil:IIPReply", "krutil:IIPCancelReply", "krutil:QVMShutdownEvent"
_STATES = {"krutil:IIPStartedEvent": State("started"), "krutil:IIPSuspendedEvent": State("suspended"),
           "krutil:IIPResumedEvent": State("resumed"), "krutil:IIPDiscardedEvent": State("discarded"),
           "krutil:IIPRequeuedEvent": State("requeued"), "krutil:IIPReactivatedEvent": State("reactivated"),
           "krutil:IIPCompletedEvent": State("completed"), "krutil:detail::LastIIPEvent": State("last")}
_TO_ENGINES = {"krutil:IIPEnqueueMessage", "krutil:IIPCancelMessage"}
_REFERRED_TO = {"krutil:EvalIIP", "krutil:FEvalIIP", "krutil:IIPResult", "krutil:FEvalResult", "krutil:QDA"}
# Of no use here: each warning that is shown has an event of its own, and an engine refuses what it cannot do.
_IGNORED = {"korvel:lang:diagnostic:IssuedWarningEvent", "krutil:capabilities_api:CapabilitiesChanged"}

_STREAMS = ("output", "error", "background")
_MOST_STATUS = 5
_EXIT, _ENTER = 1, 2


class Dispatch:
    """The open exchanges of a session, and the threads that serve them. Any thread may use it."""

    def __init__(self, session: "Session", connection: socket.socket, process: "Optional[subprocess.Popen[bytes]]",
                 reader: Reader, limits: Limits, settled: Settled, on_input: Optional[OnInput],
                 on_debug: Optional[OnDebug], on_text: Optional[OnText], on_display: Optional[OnDisplay]) -> None:
        self._session = session
        self._socket = connection
        self._process = process
        self._reader = reader
        self._limits = limits
        self._settled = settled
        self._on_input, self._on_debug, self._on_text, self._on_display = on_input, on_debug, on_text, on_display
        self._numbers = itertools.count(1)
        self._lock = threading.Lock()
        # By stream ID. It is changed under the lock; the thread that reads looks into it without.
        self._open: dict[int, Exchange] = {}
        self._last_stream = 0
        self._closing = False
        self._over = False
        # Of the thread that reads alone.
        self._running: list[Request[Any]] = []
        self._prompts: list[tuple[int, Prompt]] = []
        # By number of the display, of which there was a line.
        self._displayed: dict[int, Request[Any]] = {}
        self._shut_down = False
        self._handlers: dict[str, Callable[[Message, Optional[Exchange]], None]] = {
            "krutil:TextBaseEvent": self._text, "krutil:SinkTextEvent": self._sink_text,
            "krutil:DebugLoopEvent": self._debug_loop, "krutil:PrintableErrorEvent": self._printable_error,
            "korvel:lang:diagnostic:IssuedEnabledWarningEvent": self._warning,
            _SHUTDOWN: self._shutdown,
            **dict.fromkeys(_STATES, self._state), **dict.fromkeys(_IGNORED, lambda message, exchange: None),
        }
        #: Why the session has ended, when that was not as agreed.
        self._error: Optional[Error] = None
        self._told = self._abandoned = False
        self._all_read, self._ended = threading.Event(), threading.Event()
        self._writer = writer = Writer(connection, self._on_write_failed)
        self._lender: Optional[Lender] = None
        self._borrower: Optional[Borrower] = None
        if settled.shares and reader.descriptors is not None:
            self._lender = Lender()
            # An array may end in any thread; what the writer takes is a queue that allows that.
            self._borrower = Borrower(reader.descriptors,
                                      lambda number, kept: writer.send_return(return_bytes(number, kept)))
        self._thread = threading.Thread(target=self._run, name="krutil-reader", daemon=True)
        self._thread.start()

    def next_number(self) -> int:
        """A number that no other call has returned."""
        return next(self._numbers)

    @property
    def ended(self) -> bool:
        """Whether there is nothing more to be read."""
        with self._lock:
            return self._over

    def begin(self, make: Callable[[], E], frames: list[Frame]) -> E:
        """Opens an exchange and has its message sent. `make` makes what waits for its reply."""
        with self._lock:
            if self._over or self._closing:
                raise self._copy_of_end() if self._over else Lost("the session is closed")
            stream = self._last_stream
            while stream == 0 or stream == self._last_stream or stream in self._open:
                stream = (stream + 1) % 2**32
            buffers, size = message_bytes(stream, frames, self._settled.limits, self._lender)
            self._last_stream = stream
            exchange = make()
            self._open[stream] = exchange
            self._writer.send(buffers, size)
        return exchange

    def cancel_all(self, requests: Optional[Iterable[Request[Any]]] = None) -> None:
        """Has the engine cancel these requests, or all that are open, and does not wait for its answers."""
        if requests is None:
            # The newest first: what waits must not begin because what it waits for was cancelled.
            with self._lock:
                requests = [each for each in reversed(self._open.values()) if isinstance(each, Request)]
        for request in requests:
            try:
                request.submit_cancel()
            except Error:
                return  # The session ends or has ended, and all requests with it.

    def close(self, timeout: Optional[float]) -> bool:
        """Says goodbye, and waits for the end. Returns False when that did not come in so many seconds."""
        if threading.current_thread() is self._thread:
            raise RuntimeError("the thread that reads cannot wait for the end of its session: use another thread")
        with self._lock:
            if not self._closing and not self._over:
                self._closing = True
                goodbye = goodbye_bytes()
                self._writer.send([goodbye], len(goodbye))
        return self._ended.wait(timeout)

    def abandon(self) -> None:
        """Closes the stream, and waits until nothing is done here any more."""
        self._abandoned = True
        self._close_stream()
        if threading.current_thread() is not self._thread:
            self._ended.wait()

    def take_end(self) -> Optional[Error]:
        """Why the session has ended, when that was not as agreed. Told once."""
        told, self._told = self._told, True
        return None if told or self._abandoned else self._error

    # The thread.

    def _run(self) -> None:
        error: Optional[Error] = None
        abort = ""
        try:
            while self._read_one():
                pass
        except Violation as violation:
            abort = str(violation)
            error = Aborted(f"the engine broke the protocol: {abort}")
        except PeerAborted as reason:
            error = Aborted(f"the engine has aborted the session: {reason}")
        except (EndOfStream, OSError) as end:
            error = Lost(f"the engine has gone{how_it_ended(self._process)}: {end}")
        except Exception as fault:  # of this package; whoever waits must not wait for ever
            abort = "the program's handler failed"
            error = Aborted(f"this end of the session failed: {fault!r}")
        with self._lock:
            self._over = True
            self._error = error
            open_ = list(self._open.values())
            self._open.clear()
        self._all_read.set()
        self._writer.finish([abort_bytes(abort)] if abort else [], timeout=1)
        self._close_stream()
        self._socket.close()
        for _, prompt in self._prompts:
            prompt._close()
        for exchange in open_:
            if isinstance(exchange, Request):
                exchange._finish(self._copy_of_end())
            else:
                exchange.set_exception(self._copy_of_end())
        self._ended.set()

    def _read_one(self) -> bool:
        """Reads a message and does what it says. Returns False at the end. A message is forgotten before the next one
        is waited for: its arrays may be large."""
        message = read_message(self._reader, self._limits, self._borrower,
                               self._lender.take_back if self._lender else None)
        if message is not None:
            if self._shut_down:
                raise Violation("expected nothing after the engine's shutdown event, got another frame")
            self._handle(message)
            return True
        if not self._shut_down:
            raise OSError("the stream ended without the engine's last message")
        return False

    def _handle(self, message: Message) -> None:
        tag, stream = message.root, message.stream
        exchange = self._open.get(stream)
        handler = self._handlers.get(tag)
        if handler is not None:
            if stream and exchange is None:
                raise _misplaced(message, "is an event: expected the stream ID 0 or that of an open exchange")
            handler(message, exchange)
        elif tag == _REPLY or tag == _CANCEL_REPLY:
            if exchange is None or isinstance(exchange, Request) != (tag == _REPLY):
                raise _misplaced(message, "is a reply: expected the stream ID of an open exchange")
            finish = self._reply(message, exchange) if isinstance(exchange, Request) else \
                self._cancel_reply(message, exchange)
            with self._lock:
                del self._open[stream]
            if isinstance(exchange, Request) and exchange in self._running:
                self._running.remove(exchange)
            finish()
        elif tag in _TO_ENGINES:
            raise _misplaced(message, "goes to an engine, not to a client")
        elif tag in _REFERRED_TO:
            raise _misplaced(message, "is only ever referred to and cannot be the last frame")
        else:
            raise Violation(f'message on stream {stream}: no serializer is registered for its tag "{tag}"')

    # Replies: what they bring is read first, so nothing of a bad message reaches whoever waits.

    def _reply(self, message: Message, request: Request[Any]) -> Callable[[], None]:
        reply = message.take_root(IIPReply)
        if not reply.HasField("id"):
            raise message.unreadable("Required field is missing: protobuf::IIPReply.id")
        error = None
        values: list[Any] = []
        if reply.resultID:
            tag, result = message.take(reply.resultID,
                                       {"krutil:IIPResult": IIPResult, "krutil:FEvalResult": FEvalResult})
            if tag == "krutil:FEvalResult":
                if not result.HasField("iipResult"):
                    raise message.unreadable("Required field is missing: protobuf::FEvalResult.iipResult")
                values = [take_value(message, index, self._settled.zero_copy) for index in result.dataIDs]
                result = result.iipResult
            elif result.HasField("exception"):
                _check_status(tag, result.exception)
                error = error_from(result.exception, request._error_text)
            if not result.HasField("id"):
                raise message.unreadable("Required field is missing: protobuf::IIPResult.id")
        finish = lambda: request._finish(error, values)
        return (lambda: self._after_displays(request, finish)) if request in self._displayed.values() else finish

    def _cancel_reply(self, message: Message, answer: "Future[CancelAnswer]") -> Callable[[], None]:
        status = message.take_root(IIPCancelReply).status
        if status not in CancelAnswer._value2member_map_:
            raise message.unreadable(f"the answer to a cancel: expected 0 to 3, got {status}")
        return lambda: answer.set_result(CancelAnswer(status))

    # Displays: the engine keeps them until it is asked.

    def _after_displays(self, request: Request[Any], finish: Callable[[], None]) -> None:
        """Finishes a request that has its reply, when its displays have come, of which it has some."""
        try:
            # Before all that waits; or at the prompt at which the request ran.
            asked = self._session._submit_call("qvm.take_displays", [], 2,
                                               "DEQUEUE_AT_PPE" if self._prompts else "DEQUEUE_AT_BOOTSTRAP")
        except Error:  # The session ends, and takes no more requests.
            finish()
            return
        asked.add_done_callback(lambda _: self._take_displays(request, asked, finish))

    def _take_displays(self, request: Request[Any], asked: Request[Any], finish: Callable[[], None]) -> None:
        try:
            for display in displays_from(asked.result(0)):
                # Displays of other requests that have ended meanwhile come along.
                owner = self._displayed.pop(display.number, None)
                if owner is None or self._on_display is None:
                    continue
                owner._add(display)
                try:
                    self._on_display(display)
                except Exception:
                    sys.excepthook(*sys.exc_info())
        except Exception as error:  # Whatever the engine has returned, whoever waits must not wait for ever.
            request._add(Warned("RuntimeWarning", f"the pictures are lost: {error}", ()))
        self._displayed = {number: owner for number, owner in self._displayed.items() if owner is not request}
        finish()

    # Events.

    def _text(self, message: Message, exchange: Optional[Exchange]) -> None:
        event = message.take_root(TextBaseEvent)
        stream = _stream(message.root, event.stream)
        if isinstance(exchange, Request):
            exchange._add(Text(event.text, stream))
        elif self._running:
            # C libraries and child processes write for whichever request runs.
            self._running[-1]._add(Text(event.text, "background"))
        elif self._on_text:
            try:
                self._on_text(Text(event.text, "background"))
            except Exception:
                sys.excepthook(*sys.exc_info())

    def _sink_text(self, message: Message, exchange: Optional[Exchange]) -> None:
        event = message.take_root(SinkTextEvent)
        stream = _stream(message.root, event.stream)
        if isinstance(exchange, Request):
            line = DisplayLine.of(event.text) if self._on_display and stream == "output" else None
            if line is not None:
                self._displayed[line.number] = exchange
            exchange._add(line if line is not None else
                          Value(event.text) if stream == "output" else Text(event.text, stream))

    def _state(self, message: Message, exchange: Optional[Exchange]) -> None:
        state = _STATES[message.root]
        if isinstance(exchange, Request):
            if state == "started":
                self._running.append(exchange)
            elif state == "completed" and exchange in self._running:
                self._running.remove(exchange)
            exchange._add(state)

    def _warning(self, message: Message, exchange: Optional[Exchange]) -> None:
        warning = message.take_root(IssuedEnabledWarningEvent, frame_type=27).warningEvent.warning
        if isinstance(exchange, Request):
            exchange._add(Warned(as_text(warning.identifier), as_text(warning.message),
                                 remote_frames(warning.stack, "name")))

    def _printable_error(self, message: Message, exchange: Optional[Exchange]) -> None:
        event = message.take_root(PrintableErrorEvent)
        _check_status(message.root, getattr(event, "except"))
        if isinstance(exchange, Request):
            exchange._error_text = event.text

    def _debug_loop(self, message: Message, exchange: Optional[Exchange]) -> None:
        event = message.take_root(DebugLoopEvent)
        if event.state not in (_EXIT, _ENTER):
            raise message.unreadable(f"Invalid enum krutil::protobuf::DebugLoopEvent_State field value = {event.state}")
        if not -1 <= event.whichLoop <= 11:
            raise message.unreadable(f"Invalid enum krutil::protobuf::InputRequester field value = {event.whichLoop}")
        kind = KINDS.get(event.whichLoop)
        if kind is None or not isinstance(exchange, Request):
            return
        if event.state == _ENTER:
            # The engine asks nobody who has not said that he answers, nor twice at a time for one request.
            asks = self._on_debug if kind == "debug" else self._on_input
            if asks is None or any(stream == message.stream for stream, _ in self._prompts):
                raise message.unreadable(f"the {kind} prompt on stream {message.stream} asks nobody")
            line, shown = exchange._prompted()
            prompt = Prompt(self._session, kind, shown)
            self._prompts.append((message.stream, prompt))
            prompt._serve(self._on_input, self._on_debug, line)
        elif self._prompts and self._prompts[-1][0] == message.stream:
            self._prompts.pop()[1]._close()

    def _shutdown(self, message: Message, exchange: Optional[Exchange]) -> None:
        self._shut_down = True

    # The end.

    def _copy_of_end(self) -> Error:
        """An exception for each who asks: it gets a traceback of its own when it is raised."""
        if self._error:
            return type(self._error)(str(self._error))
        return Lost("the session is closed" if self._closing else "the engine has ended the session")

    def _on_write_failed(self) -> None:
        # The engine may have said why it does not read any more; it has a second for that to arrive.
        self._all_read.wait(1)
        self._close_stream()

    def _close_stream(self) -> None:
        try:
            self._socket.shutdown(socket.SHUT_RDWR)
        except OSError:
            pass  # It is closed already.


def _misplaced(message: Message, what: str) -> Violation:
    return Violation(f'message on stream {message.stream}: "{message.root}" {what}')


def _stream(tag: str, number: int) -> str:
    if not 0 <= number < len(_STREAMS):
        raise Violation(f'frame "{tag}": expected a stream from 0 to {len(_STREAMS) - 1}, got {number}')
    return _STREAMS[number]


def _check_status(tag: str, record: Any) -> None:
    if not 0 <= record.status <= _MOST_STATUS:
        raise Violation(f'frame "{tag}": expected a status from 0 to {_MOST_STATUS}, got {record.status}')
    for cause in record.causes:
        _check_status(tag, cause)
