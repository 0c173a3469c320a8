"""Running code that asks for a line, or that stands still until somebody has looked at it."""

import threading
from typing import TYPE_CHECKING, Callable, Optional

from .errors import Error
from .requests import Request, Result

if TYPE_CHECKING:
    from .session import Session

OnInput = Callable[["Question"], Optional[str]]
OnDebug = Callable[["Prompt"], object]

# The input loops of the protocol that a client serves.
KINDS = {1: "debug", 2: "input", 3: "keyboard", 4: "pause"}

_END_OF_INPUT = "\x04"


class Question(str):
    """What `on_input` gets: the text of the prompt, a `str` that knows whether an answer is still wanted.

    It is not when the request is cancelled or the session ends. Whatever shows a dialog can close it then.
    """

    _closed: threading.Event

    def withdrawn(self, timeout: float = 0) -> bool:
        """Whether no answer is wanted any more; waits for that, so many seconds at most."""
        return self._closed.wait(timeout)


class Prompt:
    """Code that has stopped: at `breakpoint()`, or in `qvm.keyboard()`.

    It goes on when `on_debug` returns, or ends if `quit()` was called.

    >>> def look(prompt):
    ...     print(prompt.eval("radius").value)
    ...     prompt.eval("radius = 3")
    >>> with krutil.start(on_debug=look) as session:
    ...     session.eval("def area(radius):\\n  breakpoint()\\n  return 3 * radius ** 2\\narea(2)").value
    2
    '27'
    """

    #: "debug" or "keyboard".
    kind: str
    #: Where the code has stopped, as the engine says it; empty for "keyboard".
    where: str

    def __init__(self, session: "Session", kind: str, where: str) -> None:
        self.kind = kind
        self.where = where
        self._session = session
        self._left = False
        self._closed = threading.Event()

    def eval(self, code: str, timeout: Optional[float] = None) -> Result:
        """Evaluates code where the running code stands: it reads and assigns that place's variables."""
        self._check_open()
        return self._session._wait(self._session._submit_eval(code, "DEQUEUE_AT_PPE"), None, timeout)

    def quit(self) -> None:
        """Ends the code that has stopped. Its request fails with `RemoteError` "qvm.DebuggerQuit"."""
        self._leave("import qvm; qvm.dbquit()")

    def go_on(self) -> None:
        """Lets the code go on, before `on_debug` returns."""
        self._leave("import qvm; qvm.dbcont()")

    def _leave(self, how: str) -> None:
        self._check_open()
        self._left = True
        self._answer(how, "DEQUEUE_AT_PPE")

    def _check_open(self) -> None:
        if self._left or self._closed.is_set():
            raise RuntimeError("the code does not stand still any more")

    def _answer(self, code: str, mode: str) -> None:
        """Sends an answer, and takes it back if the prompt closes without it."""
        if self._closed.is_set():
            return
        try:
            answer: "Request[Result]" = self._session._submit_eval(code, mode)
            self._closed.wait()
            if not answer.done():
                answer.submit_cancel(even_if_running=False)
        except Error:
            pass  # The session ends, and the prompt with it.

    # For the thread that reads:

    def _close(self) -> None:
        self._closed.set()

    def _serve(self, on_input: Optional[OnInput], on_debug: Optional[OnDebug], text: str) -> None:
        """Has the prompt served in a thread of its own; `text` is what an input prompt shows."""
        if self.kind in ("input", "pause"):
            ask = on_input or (lambda _: None)
            target: Callable[[], None] = lambda: self._ask(ask, text)
        else:
            look = on_debug or (lambda _: None)
            target = lambda: self._look(look)
        threading.Thread(target=target, name=f"krutil-{self.kind}", daemon=True).start()

    def _ask(self, on_input: OnInput, text: str) -> None:
        line = _END_OF_INPUT
        try:
            question = Question(text)
            question._closed = self._closed
            answer = on_input(question)
            if isinstance(answer, str):
                line = answer
            elif answer is not None:
                raise TypeError(f"on_input: expected a str or None, got {type(answer).__name__}")
        finally:
            # Whatever has happened, the code must not wait for ever.
            if self.kind == "pause":
                self._answer("", "DEQUEUE_AT_PAUSE")
            else:
                self._answer(line, "DEQUEUE_AT_PROMPT")

    def _look(self, on_debug: OnDebug) -> None:
        way_out = self.quit
        try:
            on_debug(self)
            way_out = self.go_on
        finally:
            if not self._left and not self._closed.is_set():
                way_out()
