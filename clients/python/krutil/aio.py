"""The same for programs that use asyncio.

Nothing here blocks the event loop. `on_input` and `on_debug` are ordinary functions and are called in threads of their
own, as without asyncio; `on_text` of a request is called in the event loop.

>>> async def main():
...     async with krutil.aio.start() as session:
...         first, second = session.submit("20 + 1"), session.submit_call("numpy.arange", 3)
...         print((await first).value, await second)
>>> asyncio.run(main())
21 [0 1 2]
"""

import asyncio
import contextlib
import os
from concurrent.futures import Future
from types import TracebackType
from typing import Any, AsyncIterator, Generator, Generic, Optional, TypeVar

from . import requests
from . import session as threaded
from .displays import Display, OnDisplay
from .prompts import OnDebug, OnInput
from .requests import CancelAnswer, Event, OnText, Result, Text, Warned
from .session import Command
from .wire import Limits

T = TypeVar("T")


class Request(Generic[T]):
    """A request that the engine was given. Awaited, it gives its result; see `krutil.Request` for all that it says."""

    def __init__(self, request: "requests.Request[T]") -> None:
        self._request = request

    def __await__(self) -> Generator[Any, None, T]:
        return self.result().__await__()

    async def result(self) -> T:
        """Waits for the reply. When the task that waits is cancelled, the request goes on."""
        return await _outcome(self._request._future)

    async def cancel(self, even_if_running: bool = True) -> CancelAnswer:
        """Asks the engine to cancel the request, and returns its answer.

        >>> async def main():
        ...     async with krutil.aio.start() as session:
        ...         endless, waiting = session.submit("while True: pass"), session.submit("1")
        ...         print(await waiting.cancel())
        ...         async for event in endless.events():
        ...             if event == "started":
        ...                 print(await endless.cancel())
        >>> asyncio.run(main())
        CancelAnswer.CANCELLED
        CancelAnswer.PENDING
        """
        return await _outcome(self._request.submit_cancel(even_if_running))

    async def events(self) -> AsyncIterator[Event]:
        """What happens, as it happens, up to the reply. Each call begins at the first event."""
        loop, changed = asyncio.get_running_loop(), asyncio.Event()

        def wake() -> None:
            with contextlib.suppress(RuntimeError):  # The loop is closed; nobody waits there any more.
                loop.call_soon_threadsafe(changed.set)

        position = 0
        with self._request._listening(wake):
            while True:
                changed.clear()
                # In this order: what comes before the reply is there once the reply is.
                done = self._request.done()
                arrived = self._request._so_far(position)
                position += len(arrived)
                for event in arrived:
                    yield event
                if done:
                    return
                if not arrived:
                    await changed.wait()

    def done(self) -> bool:
        """Whether there is a reply, or never will be one."""
        return self._request.done()

    @property
    def output(self) -> str:
        """What the code has written so far."""
        return self._request.output

    @property
    def value(self) -> Optional[str]:
        """The value of a trailing expression as text, if there is one."""
        return self._request.value

    @property
    def displays(self) -> tuple[Display, ...]:
        """The pictures and other forms of values that have come so far; they come at the end."""
        return self._request.displays

    @property
    def warnings(self) -> tuple[Warned, ...]:
        """The warnings so far."""
        return self._request.warnings


class Session:
    """A session with an engine, as `krutil.Session`; `start()` and `connect()` of this module make one."""

    def __init__(self, session: threaded.Session) -> None:
        self._session = session

    async def eval(self, code: str, *, on_text: Optional[OnText] = None, timeout: Optional[float] = None) -> Result:
        """Evaluates code. When the time limit, in seconds, passes or the task is cancelled, so is the request.

        >>> async def main():
        ...     async with krutil.aio.start() as session:
        ...         print(await session.eval("6 * 7", timeout=60))
        >>> asyncio.run(main())
        Result(output='', value='42', warnings=())
        """
        return await self._wait(self.submit(code), on_text, timeout)

    async def run(self, path: "str | os.PathLike[str]", *arguments: str, on_text: Optional[OnText] = None,
                  timeout: Optional[float] = None) -> Result:
        """Runs a file, as `krutil.Session.run()` does."""
        request = await asyncio.to_thread(self._session._submit_file, path, arguments)
        return await self._wait(Request(request), on_text, timeout)

    async def call(self, function: str, *arguments: Any, outputs: int = 1, on_text: Optional[OnText] = None,
                   timeout: Optional[float] = None) -> Any:
        """Calls a function with arrays, numbers and texts, as `krutil.Session.call()` does.

        >>> async def main():
        ...     async with krutil.aio.start() as session:
        ...         print(await session.call("numpy.cumsum", numpy.array([1.0, 2.0, 4.0])))
        >>> asyncio.run(main())
        [1. 3. 7.]
        """
        return await self._wait(self.submit_call(function, *arguments, outputs=outputs), on_text, timeout)

    def submit(self, code: str) -> "Request[Result]":
        """Begins what `eval()` does, and returns at once."""
        return Request(self._session.submit(code))

    def submit_call(self, function: str, *arguments: Any, outputs: int = 1) -> "Request[Any]":
        """Begins what `call()` does, and returns at once. Arguments must stay as they are until there is a reply."""
        return Request(self._session.submit_call(function, *arguments, outputs=outputs))

    async def close(self, timeout: Optional[float] = None) -> None:
        """Says goodbye, and waits until the engine has answered all requests and has shut down."""
        await asyncio.to_thread(self._session.close, timeout)

    async def kill(self) -> None:
        """Ends the session at once, whatever the engine does."""
        await asyncio.to_thread(self._session.kill)

    async def __aenter__(self) -> "Session":
        return self

    async def __aexit__(self, kind: Optional[type[BaseException]], error: Optional[BaseException],
                        traceback: Optional[TracebackType]) -> None:
        await asyncio.to_thread(self._session.__exit__, kind, error, traceback)

    async def _wait(self, request: "Request[T]", on_text: Optional[OnText], timeout: Optional[float]) -> T:
        limit = asyncio.timeout(timeout)
        try:
            async with limit:
                if on_text:
                    async for event in request.events():
                        if isinstance(event, Text):
                            on_text(event)
                return await request
        except BaseException:
            if not request.done():
                self._session._dispatch.cancel_all([request._request])
            if limit.expired():
                raise TimeoutError("there is no reply yet") from None
            raise


@contextlib.asynccontextmanager
async def start(command: Optional[Command] = None, *, on_input: Optional[OnInput] = None,
                on_debug: Optional[OnDebug] = None, on_text: Optional[OnText] = None,
                on_display: Optional[OnDisplay] = None, limits: Limits = Limits(),
                timeout: float = 10) -> AsyncIterator[Session]:
    """Starts an engine, and a session with it for a block of code. The arguments are those of `krutil.start()`."""
    begun = await asyncio.to_thread(threaded.start, command, on_input=on_input, on_debug=on_debug, on_text=on_text,
                                    on_display=on_display, limits=limits, timeout=timeout)
    async with Session(begun) as session:
        yield session


@contextlib.asynccontextmanager
async def connect(path: "str | os.PathLike[str]", *, on_input: Optional[OnInput] = None,
                  on_debug: Optional[OnDebug] = None, on_text: Optional[OnText] = None,
                  on_display: Optional[OnDisplay] = None, limits: Limits = Limits(),
                timeout: float = 10) -> AsyncIterator[Session]:
    """Begins a session with an engine that listens, for a block of code. The arguments are those of `krutil.start()`.

    >>> async def main():
    ...     async with krutil.aio.connect(listening_engine) as session:
    ...         print((await session.eval("1 + 1")).value)
    >>> asyncio.run(main())
    2
    """
    begun = await asyncio.to_thread(threaded.connect, path, on_input=on_input, on_debug=on_debug, on_text=on_text,
                                    on_display=on_display, limits=limits, timeout=timeout)
    async with Session(begun) as session:
        yield session


async def _outcome(future: "Future[T]") -> T:
    return await asyncio.wrap_future(future)
