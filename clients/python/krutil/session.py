"""A session with an engine: how it is begun, what can be asked, and how it ends."""

import errno
import functools
import os
import secrets
import shlex
import shutil
import socket
import struct
import subprocess
import threading
import time
import tokenize
from concurrent.futures import Future
from types import TracebackType
from typing import Any, Callable, Optional, Sequence, TypeVar, Union

from . import arrays
from .dispatch import Dispatch
from .displays import OnDisplay
from .errors import Refused
from .handshake import DEBUGGING, INTERACTIVE_COMMAND_LINE, WEB_WINDOW, shake_hands
from .prompts import OnDebug, OnInput
from .requests import CancelAnswer, OnText, Request, Result, Text
from .schema import CodeType, EvalIIP, FEvalIIP, IIPCancelMessage, IIPEnqueueMessage, WhenToDequeue
from .wire import Frame, Limits, Reader

T = TypeVar("T")
Command = Union[str, Sequence[str]]

# The engine need not know who asks, but refuses 0.
_ANY_ENGINE = 1

# What the kernel tells of the other end of a socket: process, user, group.
_PEER = struct.Struct("iII")

# What all evaluations and calls begin with. Serialized messages can be joined, and to serialize this each time takes
# longer than all the rest of them.
_CORE = EvalIIP(iip={"pluginType": "python", "outTraits": {}, "errTraits": {}}).SerializeToString()


class Session:
    """A session with an engine. `start()` and `connect()` make one.

    Any thread may use it. Requests run one after another, in the order in which they were made. As a context manager it
    ends with `close()`; when an exception leaves the block, what has no reply is cancelled before.
    """

    def __init__(self, connection: socket.socket, process: "Optional[subprocess.Popen[bytes]]" = None, *,
                 on_input: Optional[OnInput] = None, on_debug: Optional[OnDebug] = None,
                 on_text: Optional[OnText] = None, on_display: Optional[OnDisplay] = None, limits: Limits = Limits(),
                 timeout: float = 10) -> None:
        """A session over a connected stream socket, which it owns from now on, with its engine's process if that ends
        with it. The arguments are told under `start()`."""
        capabilities = [INTERACTIVE_COMMAND_LINE] if on_input else []
        if on_debug:
            capabilities.append(DEBUGGING)
        if on_display:
            capabilities.append(WEB_WINDOW)
        reader = Reader(connection)
        self._process = process
        settled = shake_hands(connection, process, reader, limits, capabilities, timeout)
        self._zero_copy = settled.zero_copy
        # The upper half of all identifiers; the lower one counts.
        self._identity = secrets.randbits(64)
        self._dispatch = Dispatch(self, connection, process, reader, limits, settled, on_input, on_debug, on_text,
                                  on_display)

    def eval(self, code: str, *, on_text: Optional[OnText] = None, timeout: Optional[float] = None) -> Result:
        """Evaluates code, and returns its output and the value of a trailing expression as text.

        `on_text` is called in this thread with each `Text` that the code writes, as it comes. After `timeout` seconds
        the request is cancelled and `TimeoutError` is raised; so it is for an exception that hits this thread, such as
        KeyboardInterrupt. Raises what `Request.result()` raises.

        >>> with krutil.start() as session:
        ...     session.eval("print('hello'); 6 * 7")
        Result(output='hello\\n', value='42', warnings=())
        """
        return self._wait(self.submit(code), on_text, timeout)

    def run(self, path: "str | os.PathLike[str]", *arguments: str, on_text: Optional[OnText] = None,
            timeout: Optional[float] = None) -> Result:
        """Runs a file of this machine as `python3 PATH ARGUMENT...` does, among the names of the session.

        Tracebacks name the file, modules beside it are found, and `sys.argv` has the arguments. The file is read here,
        so an engine elsewhere need not have it. No value of an expression is shown. `on_text` and `timeout` are those
        of `eval()`. Raises `OSError` when the file cannot be read, and `SyntaxError` when it is not in the encoding
        that it states.

        >>> import tempfile
        >>> with tempfile.NamedTemporaryFile("w", suffix=".py") as file, krutil.start() as session:
        ...     print("import sys; print('hello', *sys.argv[1:])", file=file, flush=True)
        ...     session.run(file.name, "world").output
        'hello world\\n'
        """
        return self._wait(self._submit_file(path, arguments), on_text, timeout)

    def call(self, function: str, *arguments: Any, outputs: int = 1, on_text: Optional[OnText] = None,
             timeout: Optional[float] = None) -> Any:
        """Calls a function of the engine by its name, such as "numpy.linalg.qr", and returns its value as an array.

        Arguments are arrays, numbers and texts. With `outputs` greater than 1 the function has to return so many
        values, which come as a tuple; with 0 there is None. What is text comes as a `str`, all else as a NumPy array.
        Elements are not copied on the way: an argument must stay as it is until its call has ended. `on_text` and
        `timeout` are those of `eval()`. An argument that cannot be sent is a `TypeError`, one that is larger than the
        engine accepts a `ValueError`.

        >>> with krutil.start() as session:
        ...     session.call("numpy.cumsum", numpy.array([1.0, 2.0, 4.0]))
        ...     session.call("divmod", 17, 5, outputs=2)
        array([1., 3., 7.])
        (array(3), array(2))
        """
        return self._wait(self.submit_call(function, *arguments, outputs=outputs), on_text, timeout)

    def submit(self, code: str) -> "Request[Result]":
        """Begins what `eval()` does, and returns at once.

        >>> with krutil.start() as session:
        ...     first, second = session.submit("x = 20"), session.submit("x + 1")
        ...     second.result().value
        '21'
        """
        return self._submit_eval(code, "DEQUEUE_AT_IDLE")

    def submit_call(self, function: str, *arguments: Any, outputs: int = 1) -> "Request[Any]":
        """Begins what `call()` does, and returns at once. Arguments must stay as they are until there is a reply.

        >>> with krutil.start() as session:
        ...     session.submit_call("numpy.arange", 3).result()
        array([0, 1, 2])
        """
        return self._submit_call(function, arguments, outputs, "DEQUEUE_AT_IDLE")

    def close(self, timeout: Optional[float] = None) -> None:
        """Says goodbye, and waits until the engine has answered all requests and has shut down.

        Raises `TimeoutError` if that takes more than so many seconds; the session is still ending then. Raises `Lost`
        or `Aborted` when the session has ended in another way. Closing a closed session does nothing.
        """
        end = None if timeout is None else time.monotonic() + timeout
        if not self._dispatch.close(timeout):
            raise TimeoutError(f"the engine has not shut down within {timeout:g} seconds")
        if self._process:
            try:
                self._process.wait(None if end is None else max(end - time.monotonic(), 0))
            except subprocess.TimeoutExpired:
                raise TimeoutError(f"the engine's process has not ended within {timeout:g} seconds") from None
        error = self._dispatch.take_end()
        if error:
            raise error

    @property
    def ended(self) -> bool:
        """Whether the session is over, however it came to that: a request that is made now raises `Lost`."""
        return self._dispatch.ended

    def kill(self) -> None:
        """Ends the session at once, whatever the engine does, and its process if `start()` has started it."""
        self._dispatch.abandon()
        if self._process:
            self._process.kill()
            self._process.wait()

    def __enter__(self) -> "Session":
        return self

    def __exit__(self, kind: Optional[type[BaseException]], error: Optional[BaseException],
                 traceback: Optional[TracebackType]) -> None:
        try:
            if error is not None:
                self._dispatch.cancel_all()
            self.close()
        except BaseException as other:
            self.kill()
            # What has gone wrong first is what matters.
            if error is None or not isinstance(other, Exception):
                raise

    # What prompts and requests need of it.

    def _submit_eval(self, code: str, mode: str) -> "Request[Result]":
        if not isinstance(code, str):
            raise TypeError(f"code: expected a str, got {type(code).__name__}")
        # Partial: no field is required, so nobody need look for one that is missing.
        return self._enqueue([], "krutil:EvalIIP", EvalIIP(cmd=code).SerializePartialToString(), mode, _eval_result)

    def _submit_file(self, path: "str | os.PathLike[str]", arguments: Sequence[str]) -> "Request[Result]":
        with tokenize.open(path) as file:
            code = file.read()
        # A request of its own: the file may begin with what must be the first statement.
        self.submit(f"__import__('sys').argv = {[os.fspath(path), *arguments]!r}")
        request = EvalIIP(cmd=code, codeType=CodeType["ScriptType"])
        return self._enqueue([], "krutil:EvalIIP", request.SerializePartialToString(), "DEQUEUE_AT_IDLE", _eval_result,
                             os.path.abspath(path))

    def _submit_call(self, function: str, arguments: Sequence[Any], outputs: int, mode: str) -> "Request[Any]":
        check_function(function)
        frames: list[Frame] = []
        indexes = [arrays.add_argument(frames, argument, self._zero_copy) for argument in arguments]
        request = _call_request(function, outputs, tuple(indexes))
        return self._enqueue(frames, "krutil:FEvalIIP", request, mode, _call_result(outputs))

    def _submit_cancel(self, identifier: tuple[int, int], even_if_running: bool) -> "Future[CancelAnswer]":
        message = IIPCancelMessage(evenIfRunning=even_if_running)
        message.iipid.hi, message.iipid.lo = identifier
        answer: "Future[CancelAnswer]" = Future()
        answer.set_running_or_notify_cancel()
        self._dispatch.begin(lambda: answer, [Frame("krutil:IIPCancelMessage", 27, message.SerializeToString())])
        return answer

    def _enqueue(self, frames: list[Frame], tag: str, request: bytes, mode: str,
                 make_result: Callable[["Request[Any]", Any], Any], name: str = "") -> "Request[Any]":
        frames.append(Frame(tag, 29, _CORE + request))
        identifier = self._identity, self._dispatch.next_number()
        enqueue = IIPEnqueueMessage(iipHandle=len(frames), dequeueMode=WhenToDequeue[mode], name=name)
        enqueue.iipid.hi, enqueue.iipid.lo = identifier
        frames.append(Frame("krutil:IIPEnqueueMessage", 27, enqueue.SerializePartialToString()))
        made: "Request[Any]" = self._dispatch.begin(
            lambda: Request(self, identifier, make_result), frames)
        return made

    def _wait(self, request: "Request[T]", on_text: Optional[OnText], timeout: Optional[float]) -> T:
        end = None if timeout is None else time.monotonic() + timeout
        try:
            if on_text:
                for event in request.events(timeout):
                    if isinstance(event, Text):
                        on_text(event)
            return request.result(None if end is None else max(end - time.monotonic(), 0))
        except BaseException:
            if not request.done():
                self._dispatch.cancel_all([request])
            raise


def start(command: Optional[Command] = None, *, on_input: Optional[OnInput] = None, on_debug: Optional[OnDebug] = None,
          on_text: Optional[OnText] = None, on_display: Optional[OnDisplay] = None, limits: Limits = Limits(),
          timeout: float = 10) -> Session:
    """Starts an engine as a child of this process, and a session with it. Both end together.

    `command` is what to run: a list of words, or text that is taken apart as a shell does. Its standard input and
    output carry the session, so it may be `"ssh somewhere krutil-qvm --stdio"`. Without it, `krutil-qvm` is looked for
    in the PATH. Lines that the engine writes to its standard error go to this process's own.

    `on_input` answers code that reads a line: it gets the text of the prompt, and returns the line, or None for the end
    of input. `on_debug` serves code that stops: it gets a `Prompt`. Each is called in a thread of its own. Without them
    the engine never asks. `on_text` gets text that comes while no request runs, in the thread that reads, so it must
    return soon. `on_display` gets each `Display`, in that thread too, before the result of its request is there;
    without it, code shows no pictures. `limits` is what this end accepts. `timeout` is what the engine has for its
    handshake, in seconds.

    Raises `Refused`, `Aborted` or `Lost` when there is no session, and `FileNotFoundError` when there is no program.

    >>> with krutil.start() as session:
    ...     session.eval("1 + 1").value
    '2'
    """
    words = ["krutil-qvm", "--stdio"] if command is None else \
        shlex.split(command) if isinstance(command, str) else list(command)
    if not words:
        raise ValueError("command: expected the words that run an engine, got none")
    program = shutil.which(words[0])
    if program is None:
        raise FileNotFoundError(f"there is no program '{words[0]}' to be the engine: put its directory into PATH, "
                                f"or give the command")
    ours, theirs = socket.socketpair()
    with theirs:
        # Ctrl-C reaches this process and its engine. This end makes a cancel of it, so the engine must not hear of it.
        process = subprocess.Popen(["/bin/sh", "-c", 'trap "" INT; exec "$@"', "sh", program, *words[1:]],
                                   stdin=theirs.fileno(), stdout=theirs.fileno())
    try:
        return Session(ours, process, on_input=on_input, on_debug=on_debug, on_text=on_text,
                       on_display=on_display, limits=limits, timeout=timeout)
    except BaseException:
        ours.close()
        process.kill()
        process.wait()
        raise


def connect(path: "str | os.PathLike[str]", *, on_input: Optional[OnInput] = None, on_debug: Optional[OnDebug] = None,
            on_text: Optional[OnText] = None, on_display: Optional[OnDisplay] = None, limits: Limits = Limits(),
          timeout: float = 10) -> Session:
    """Begins a session with an engine that listens (`krutil-qvm --listen PATH`). The arguments are those of `start()`.

    Raises `OSError` when nothing listens there, and `Refused` when another user's engine does: whoever has made the
    socket gets the code.

    >>> with krutil.connect(listening_engine) as session:
    ...     session.eval("1 + 1").value
    '2'
    """
    connection = socket.socket(socket.AF_UNIX)
    try:
        try:
            connection.connect(os.fspath(path))
        except OSError as error:
            raise OSError(error.errno or errno.ENAMETOOLONG,
                          f"no engine can be reached there: {error.strerror or error}", os.fspath(path)) from None
        _, user, _ = _PEER.unpack(connection.getsockopt(socket.SOL_SOCKET, socket.SO_PEERCRED, _PEER.size))
        if user not in (os.geteuid(), 0):  # root, where the system's service manager listens for the engine
            raise Refused(f"cannot connect to '{os.fspath(path)}': the engine there runs as user {user}, not as user "
                          f"{os.geteuid()} as this program does")
        return Session(connection, on_input=on_input, on_debug=on_debug, on_text=on_text,
                       on_display=on_display, limits=limits, timeout=timeout)
    except BaseException:
        connection.close()
        raise


def check_function(function: object) -> None:
    """A function of this process cannot be sent, so that it is given by mistake is said at once."""
    if not isinstance(function, str):
        raise TypeError("function: expected the name of a function of the engine, such as 'numpy.linalg.inv'; got "
                        f"{type(function).__name__}")


@functools.lru_cache(maxsize=64)
def _call_request(function: str, outputs: int, indexes: tuple[int, ...]) -> bytes:
    """What a call of the function says, without its arguments. Calls in a loop say the same each time."""
    made: bytes = FEvalIIP(functionName=function, nlhs=outputs, dataIDs=indexes, clientQvmID=_ANY_ENGINE,
                           serverQvmID=_ANY_ENGINE).SerializePartialToString()
    return made


def _eval_result(request: "Request[Any]", _: Any) -> Result:
    return Result(request.output, request.value, request.warnings, request.displays)


def _call_result(outputs: int) -> Callable[["Request[Any]", Any], Any]:
    def make(_: "Request[Any]", values: Any) -> Any:
        if len(values) != outputs:
            raise Refused(f"the engine has returned {len(values)} outputs; {outputs} were asked for")
        return None if outputs == 0 else values[0] if outputs == 1 else tuple(values)

    return make
