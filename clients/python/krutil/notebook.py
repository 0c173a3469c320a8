"""What answers Jupyter: one engine, asked for what cells, completion and inspection need.

This process is started by Jupyter, as `krutil.kernel` says. Three threads of it serve Jupyter: the main thread runs
cells, one after another; the control thread interrupts and ends; a third one publishes output.
"""

import base64
import json
import platform
import re
import sys
import threading
from typing import Any, Callable, Optional, Sequence

from ipykernel.kernelbase import Kernel

from .displays import Display, DisplayLine
from .errors import Cancelled, Error, Lost, RemoteError
from .prompts import Question
from .requests import Request, Text, Value, Warned
from .session import Session, start

# What the engine has for an answer about code, in seconds. It may be far away, but a person waits.
_PATIENCE = 5.0
# After this many seconds a person is told why an interrupt has no effect yet.
_INTERRUPT_SHOWS = 2.0
# What an engine has for its exit functions, in seconds. Jupyter itself kills kernels after five.
_SHUTDOWN = 3.0

_RED, _GREEN, _CYAN, _PLAIN = "\x1b[0;31m", "\x1b[0;32m", "\x1b[0;36m", "\x1b[0m"
_FRAME = re.compile(r'^(\s*File )(".*")(, line )(\d+)((?:, in )?)(.*)$')
_SYNTAX_LINE = re.compile(r", line ([0-9]+)\)$")
_ERROR_LINE = re.compile(r"^[\s|+-]*([A-Za-z_][\w.]*)(:\s.*)?$")


class EngineKernel(Kernel):
    """The kernel. Its engine is started with the first cell, and again after it was lost."""

    implementation = "krutil"
    implementation_version = "0.1.0"
    banner = "Python in an engine of its own (krutil-qvm)"
    language_info = {"name": "python", "version": platform.python_version(), "mimetype": "text/x-python",
                     "file_extension": ".py", "pygments_lexer": "python3", "nbconvert_exporter": "python",
                     "codemirror_mode": {"name": "python", "version": 3}}

    #: The words of the engine's command; None is `krutil-qvm` from the PATH.
    command: Optional[Sequence[str]] = None

    def __init__(self, **options: Any) -> None:
        super().__init__(**options)
        self._engine: Optional[Session] = None
        # The request of the cell that runs, for the control thread.
        self._running: "Optional[Request[Any]]" = None
        self._interrupted = False
        self._may_ask = False

    # What cells ask for.

    def do_execute(self, code: str, silent: bool, store_history: bool = True,
                   user_expressions: Optional[dict[str, str]] = None, allow_stdin: bool = False,
                   *, cell_id: Optional[str] = None) -> dict[str, Any]:
        self._may_ask = allow_stdin
        try:
            data = self._run(code, silent)
            # As in other notebooks, a semicolon at the end hides the value.
            if data and not silent and not code.rstrip().endswith(";"):
                self._publish("execute_result", {"execution_count": self.execution_count, "metadata": {}, "data": data})
            expressions = {name: self._expression(text) for name, text in (user_expressions or {}).items()}
            return {"status": "ok", "execution_count": self.execution_count, "payload": [],
                    "user_expressions": expressions}
        except (Error, OSError) as error:
            content = self._error(error)
            content["traceback"] += _hint(code, error)
            if not silent:
                self._publish("error", content)
            return {"status": "error", "execution_count": self.execution_count, **content}

    def do_complete(self, code: str, cursor_pos: int) -> dict[str, Any]:
        answer = self._ask("qvm.complete", code, cursor_pos, outputs=3)
        begin, end, candidates = answer if answer else (cursor_pos, cursor_pos, "")
        return {"status": "ok", "matches": str(candidates).split("\n") if candidates else [],
                "cursor_start": int(begin), "cursor_end": int(end), "metadata": {}}

    def do_inspect(self, code: str, cursor_pos: int, detail_level: int = 0,
                   omit_sections: Sequence[str] = ()) -> dict[str, Any]:
        text = self._ask("qvm.inspect", code, cursor_pos) or ""
        return {"status": "ok", "found": bool(text), "data": {"text/plain": text} if text else {}, "metadata": {}}

    def do_is_complete(self, code: str) -> dict[str, Any]:
        answer = self._ask("qvm.is_complete", code, outputs=2)
        if not answer:
            return {"status": "unknown"}
        status, indentation = answer
        return {"status": status, **({"indent": indentation} if status == "incomplete" else {})}

    # What the control thread is asked for, while a cell runs.

    async def interrupt_request(self, stream: Any, ident: Any, parent: Any) -> None:
        request = self._running
        if request is not None and not request.done():
            self._interrupted = True
            try:
                request.submit_cancel()
            except Error:
                pass  # The cell says what has become of its engine.
            waiting = threading.Timer(_INTERRUPT_SHOWS, self._say_that_it_still_runs, [request])
            waiting.daemon = True
            waiting.start()
        self.session.send(stream, "interrupt_reply", {"status": "ok"}, parent, ident=ident)

    def do_shutdown(self, restart: bool) -> dict[str, Any]:
        engine, self._engine = self._engine, None
        request = self._running
        if engine is not None:
            try:
                if request is not None and not request.done():
                    request.submit_cancel()
                engine.close(_SHUTDOWN)
            except (Error, TimeoutError):
                pass  # It has gone already, or has to be ended.
            engine.kill()
        return {"status": "ok", "restart": restart}

    # With the engine:

    def _session(self) -> Session:
        if self._engine is None:
            self._engine = start(self.command, on_input=self._answer, on_text=self._background,
                                 on_display=lambda display: None, timeout=60)
            self._ask("qvm.bind_display", outputs=0)
        return self._engine

    def _run(self, code: str, silent: bool) -> dict[str, str]:
        """Runs a cell and publishes what it writes and shows, as it comes. Returns the forms of its value."""
        self._interrupted = False
        request = self._running = self._session().submit(code)
        forms: dict[str, str] = {}
        of_value = 0
        before: Any = None
        try:
            for event in request.events():
                if silent:
                    continue
                if isinstance(event, Text):
                    (sys.stderr if event.stream == "error" else sys.stdout).write(event)
                elif isinstance(event, Warned):
                    sys.stderr.write(_warning_text(event))
                elif isinstance(event, DisplayLine):
                    # Behind a value is what the value has beside its text. A PNG alone may as well be a figure.
                    if isinstance(before, Value) and event.types != ("image/png",):
                        of_value = event.number
                    else:
                        self._show("display_data", event.number, {"text/plain": event.rstrip()})
                elif isinstance(event, Display) and event.number == of_value:
                    forms = _bundle(event)
                elif isinstance(event, Display):
                    self._show("update_display_data", event.number, _bundle(event))
                before = event
            result = request.result()
        finally:
            self._running = None
            sys.stdout.flush()
            sys.stderr.flush()
        if self._interrupted and not silent:
            sys.stderr.write("The interrupt had no effect: the code has caught it, or was done before.\n")
        return {"text/plain": result.value, **forms} if result.value is not None else forms

    def _expression(self, code: str) -> dict[str, Any]:
        try:
            return {"status": "ok", "data": self._run(code, True) or {"text/plain": "None"}, "metadata": {}}
        except Error as error:
            return {"status": "error", **self._error(error)}

    def _ask(self, function: str, *arguments: Any, outputs: int = 1) -> Any:
        """Asks a function of the engine about code. None without an answer: no cell has failed because of that."""
        try:
            return self._session().call(function, *arguments, outputs=outputs, timeout=_PATIENCE)
        except (Error, OSError) as error:
            self.log.debug("%s: %s", function, error)
            return None

    def _answer(self, question: Question) -> Optional[str]:
        """Has the page ask for a line. This runs in a thread of its own, while the main thread waits for the cell."""
        if not self._may_ask:
            return None
        sys.stdout.flush()
        sys.stderr.flush()
        while self.stdin_socket.poll(0):
            self.session.recv(self.stdin_socket)  # an answer to a question that was withdrawn
        self.session.send(self.stdin_socket, "input_request", {"prompt": str(question), "password": False},
                          self.get_parent("shell"), ident=self._parent_ident["shell"])
        while not question.withdrawn():
            if self.stdin_socket.poll(50):
                _, reply = self.session.recv(self.stdin_socket)
                if reply is not None:
                    return str(reply["content"]["value"])
        return None

    # What is shown:

    def set_parent(self, ident: Any, parent: Any, channel: str = "shell") -> None:
        super().set_parent(ident, parent, channel)
        if channel == "shell":
            for stream in (sys.stdout, sys.stderr):
                tell: Optional[Callable[[Any], None]] = getattr(stream, "set_parent", None)
                if tell:
                    tell(parent)

    def _publish(self, kind: str, content: dict[str, Any]) -> None:
        self.send_response(self.iopub_socket, kind, content)

    def _show(self, kind: str, number: int, data: dict[str, str]) -> None:
        """Keeps the place of a display in the output, where its line stands, or fills it."""
        sys.stdout.flush()
        sys.stderr.flush()
        self._publish(kind, {"data": data, "metadata": {},
                             "transient": {"display_id": f"{self.ident}-{self.execution_count}-{number}"}})

    @staticmethod
    def _background(text: str) -> None:
        sys.stdout.write(text)

    def _say_that_it_still_runs(self, request: "Request[Any]") -> None:
        if not request.done():
            sys.stderr.write("The engine has the interrupt, but the code still runs: it is inside a function that is "
                             "not written in Python, or has caught the interrupt. A restart of the kernel ends it.\n")
            sys.stderr.flush()

    def _error(self, error: Exception) -> dict[str, Any]:
        """The error as a page shows it. After a lost engine, the next cell begins with a new one."""
        if isinstance(error, RemoteError):
            return {"ename": error.identifier, "evalue": error.message, "traceback": coloured(error.text or str(error))}
        if isinstance(error, Cancelled):
            name, what = "KeyboardInterrupt", "the cell was interrupted; what it has done so far stays"
        else:
            name, what = type(error).__name__, str(error)
        if isinstance(error, Lost) and self._engine is not None:
            engine, self._engine = self._engine, None
            engine.kill()
            what += ". All its names are lost; the next cell begins with a new engine"
        return {"ename": name, "evalue": what, "traceback": [f"{_RED}{name}{_PLAIN}: {what}"]}


def coloured(text: str) -> list[str]:
    """The lines of an error as Python prints it, with places and the names of errors in colours."""
    lines = []
    for line in text.rstrip("\n").split("\n"):
        frame, error = _FRAME.match(line), _ERROR_LINE.match(line)
        if frame:
            before, file, between, number, in_, function = frame.groups()
            line = f"{before}{_GREEN}{file}{_PLAIN}{between}{_GREEN}{number}{_PLAIN}{in_}{_CYAN}{function}{_PLAIN}"
        elif error and not line.startswith("    "):
            at = error.start(1)
            line = f"{line[:at]}{_RED}{error[1]}{_PLAIN}{error[2] or ''}"
        lines.append(line)
    return lines


def _hint(code: str, error: Exception) -> list[str]:
    """What to type for a line that other kernels take as a command."""
    place = _SYNTAX_LINE.search(error.message) if isinstance(error, RemoteError) else None
    line = next(iter(code.split("\n")[int(place[1]) - 1:]), "").strip() if place else ""
    if line.startswith("%"):
        return ["Lines are Python. There are no commands that begin with %."]
    if line.startswith("!"):
        return ["Lines are Python. This runs a command where the engine is:",
                f"    import subprocess; subprocess.run({json.dumps(line[1:].strip(), ensure_ascii=False)}, shell=True)"]
    return []


def _bundle(display: Display) -> dict[str, str]:
    """The forms of a display as Jupyter has them."""
    return {kind: base64.b64encode(content).decode() if isinstance(content, bytes) else content
            for kind, content in display.formats.items()}


def _warning_text(warned: Warned) -> str:
    place = f"{warned.frames[-1].file}:{warned.frames[-1].line}: " if warned.frames else ""
    return f"{place}{warned.identifier}: {warned.message}\n"
