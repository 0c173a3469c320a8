"""Many engines, which share the calls of a program among them."""

import threading
import warnings
from collections import deque
from concurrent.futures import Executor, Future, ThreadPoolExecutor
from typing import Any, Optional, Sequence, Union

from .errors import Error, Lost
from .session import Command, Session, check_function, start


class _Call:
    """A call that waits for an engine."""

    def __init__(self, function: str, arguments: Sequence[Any], outputs: int) -> None:
        self.future: "Future[Any]" = Future()
        self._function = function
        self._arguments = arguments
        self._outputs = outputs

    def run(self, session: Session) -> None:
        try:
            result = session.call(self._function, *self._arguments, outputs=self._outputs)
        except BaseException as error:
            self.future.set_exception(error)
        else:
            self.future.set_result(result)


class Pool(Executor):
    """Engines that run calls, each one after another: a `concurrent.futures.Executor`.

    `engines` is a number of engines on this machine, or the commands that run them, which may be elsewhere:
    `Pool(["ssh a krutil-qvm --stdio", "ssh b krutil-qvm --stdio"])`. They are started at once; what hinders one of them
    is raised here. `timeout` is what each has for its handshake, in seconds.

    An engine that is lost fails the call that it was running, with `Lost`. No call is made twice: whether that call may
    be repeated, only its caller knows. The engine is started again when it has a call to run. If that fails, there is a
    warning, and the others do its work; when none is left, the calls that wait fail with `Lost`, and so do later ones.

    At the end of a block, or with `shutdown()`, all calls have ended and the engines have shut down. Any thread may use
    a pool.

    >>> with krutil.Pool(2) as pool:
    ...     inverse = pool.submit("numpy.linalg.inv", numpy.array([[2.0, 0.0], [0.0, 4.0]]))
    ...     print(inverse.result())
    ...     print([int(each) for each in pool.map("sum", [[1, 2], [3, 4], [5, 6]])])
    [[0.5  0.  ]
     [0.   0.25]]
    [3, 7, 11]
    """

    def __init__(self, engines: Union[int, Sequence[Command]], *, timeout: float = 60) -> None:
        if isinstance(engines, str):
            raise TypeError(f"engines: expected a number or a list of commands, got a str; for one engine: [{engines!r}]")
        commands: Sequence[Optional[Command]] = [None] * engines if isinstance(engines, int) else list(engines)
        if not commands:
            raise ValueError("a pool needs one engine or more")
        self._timeout = timeout
        self._changed = threading.Condition()
        # Under the lock of the condition:
        self._waiting: "deque[_Call]" = deque()
        self._closed = False
        self._serving = len(commands)
        self._broken = ""
        sessions = self._start_all(commands)
        self._threads = [threading.Thread(target=self._serve, args=each, name="krutil-pool", daemon=True)
                         for each in zip(commands, sessions)]
        for thread in self._threads:
            thread.start()

    def submit(self, function: str, /, *arguments: Any, outputs: int = 1) -> "Future[Any]":  # type: ignore[override]
        """Has an engine call a function; arguments and outputs are those of `Session.call()`. An argument must stay as
        it is until the future is done. A call that waits for an engine can be cancelled, and one that runs cannot."""
        check_function(function)
        call = _Call(function, arguments, outputs)
        with self._changed:
            if self._closed:
                raise RuntimeError("the pool is shut down")
            if self._broken:
                call.future.set_exception(Lost(self._broken))
            else:
                self._waiting.append(call)
                self._changed.notify()
        return call.future

    def shutdown(self, wait: bool = True, *, cancel_futures: bool = False) -> None:
        """Takes no more calls. The engines shut down when no call is left; with `wait`, returns then. With
        `cancel_futures`, calls that wait for an engine are cancelled."""
        with self._changed:
            self._closed = True
            if cancel_futures:
                for call in self._waiting:
                    call.future.cancel()
            self._changed.notify_all()
        if wait:
            for thread in self._threads:
                thread.join()

    def _start_all(self, commands: Sequence[Optional[Command]]) -> list[Session]:
        with ThreadPoolExecutor(len(commands)) as starters:
            started = [starters.submit(self._start, command) for command in commands]
        errors = [each.exception() for each in started]
        error = next((each for each in errors if each is not None), None)
        if error is not None:
            for each, its_error in zip(started, errors):
                if its_error is None:
                    each.result().kill()
            raise error
        return [each.result() for each in started]

    def _start(self, command: Optional[Command]) -> Session:
        return start(command, timeout=self._timeout)

    # In a thread for each engine:

    def _serve(self, command: Optional[Command], session: Session) -> None:
        while True:
            call = self._next_call()
            if call is None:
                break
            if session.ended:
                session.kill()
                try:
                    session = self._start(command)
                except (Error, OSError) as error:
                    self._retire(call, error)
                    return
            if call.future.set_running_or_notify_cancel():
                call.run(session)
            del call  # Its arguments may be large.
        try:
            session.close()
        except Error:
            session.kill()

    def _next_call(self) -> Optional[_Call]:
        with self._changed:
            self._changed.wait_for(lambda: self._waiting or self._closed)
            return self._waiting.popleft() if self._waiting else None

    def _retire(self, call: _Call, error: Exception) -> None:
        """The thread ends, because its engine cannot be started again. The call was not sent, so another engine may run
        it."""
        left_over = [call]
        with self._changed:
            self._serving -= 1
            if self._serving:
                self._waiting.appendleft(call)
                self._changed.notify()
                left_over = []
            else:
                self._broken = f"no engine of the pool can be started again: {error}"
                left_over += self._waiting
                self._waiting.clear()
        warnings.warn(f"an engine of the pool cannot be started again: {error}", RuntimeWarning, 1)
        for each in left_over:
            if each.future.set_running_or_notify_cancel():
                each.future.set_exception(Lost(self._broken))
