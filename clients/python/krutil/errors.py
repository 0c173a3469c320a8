"""What can go wrong, as exceptions.

`RemoteError` is what code raised on the engine. All others tell what became of a request or of the session.
"""

import ast
import re
import sys
import types
from typing import Any, NamedTuple, Optional

from .schema import ExecutionStatus


# Control characters but newline and tab, separators of lines and paragraphs, controls of direction.
_STEERS_TERMINAL = re.compile("[\x00-\x08\x0b-\x1f\x7f-\x9f\u061c\u200e\u200f\u2028-\u202e\u2066-\u2069]")


def safe_text(text: str) -> str:
    """The text with whatever would steer a terminal, or change how a line reads, as an escape."""
    return _STEERS_TERMINAL.sub(lambda found: found.group().encode("unicode_escape").decode("ascii"), text)


class Error(Exception):
    """The base of all exceptions of this package. What the engine says cannot steer a terminal on which it is printed."""

    def __str__(self) -> str:
        return safe_text(super().__str__())


class Cancelled(Error):
    """The request was cancelled before it came to its end."""


class Refused(Error):
    """The engine does not run the request, cannot send its result, or does not take part in a session with this end."""


class Aborted(Error):
    """One end broke the protocol, and the session has ended because of that. The text says which end, and how."""


class Lost(Error):
    """The stream, and with it the session, has ended before the engine had answered."""


class RemoteFrame(NamedTuple):
    """One entry of the stack of code on the engine."""

    file: str
    function: str
    line: int


class RemoteError(Error):
    """Code on the engine raised an error, or does not compile.

    Printed, it looks as if the code had run here: its traceback shows the frames of the engine, and its `__cause__` is
    the error that caused it. Source lines are shown where the file can be read here, too.

    >>> with krutil.start() as session:
    ...     try:
    ...         session.eval("int('twelve')")
    ...     except krutil.RemoteError as error:
    ...         print(error.identifier, "-", error.message)
    ValueError - invalid literal for int() with base 10: 'twelve'
    """

    #: The type of the error, such as "ValueError" or "numpy.linalg.LinAlgError".
    identifier: str
    #: What the error says.
    message: str
    #: The stack, from the outermost frame to the innermost.
    frames: tuple[RemoteFrame, ...]
    #: The errors that caused this one: one that it was raised from, or the members of a group.
    causes: tuple["RemoteError", ...]
    #: The error with its stack and causes as the engine prints it. Empty for a cause.
    text: str

    def __init__(self, identifier: str, message: str, frames: tuple[RemoteFrame, ...] = (),
                 causes: tuple["RemoteError", ...] = (), text: str = "") -> None:
        super().__init__(f"{identifier}: {message}" if message else identifier)
        self.identifier = identifier
        self.message = message
        self.frames = frames
        self.causes = causes
        self.text = text
        self.__cause__ = causes[0] if causes else None
        self.__traceback__ = _traceback(frames)

    def __reduce__(self) -> Any:
        return RemoteError, (self.identifier, self.message, self.frames, self.causes, self.text)


def error_from(record: Any, text: str = "") -> Error:
    """The exception for a `RuntimeException` of the protocol; `text` is how the engine prints it."""
    if record.status == ExecutionStatus["inEXECUTION_CTRLC"]:
        return Cancelled(record.msgText or record.msgID)
    if record.status == ExecutionStatus["inCOMM_ERROR"]:
        return Refused(record.msgText)
    return _remote_error(record, text)


def remote_frames(stack: Any, function_field: str) -> tuple[RemoteFrame, ...]:
    """The frames of an error (`function_field` "func") or of a warning ("name")."""
    return tuple(RemoteFrame(as_text(frame.file), as_text(getattr(frame, function_field)), _line(frame.line))
                 for frame in stack)


def as_text(value: "str | bytes") -> str:
    """Texts of warnings may be any bytes; those that are no text come as bytes."""
    return value.decode("utf-8", "replace") if isinstance(value, bytes) else value


def _remote_error(record: Any, text: str) -> RemoteError:
    causes = tuple(_remote_error(cause, "") for cause in record.causes)
    return RemoteError(record.msgID, record.msgText, remote_frames(record.frames, "func"), causes, text)


def _line(number: float) -> int:
    # Lines travel as doubles, and a peer may send any of these.
    return int(number) if 0 < number < 2**31 else 1


def _frame_maker() -> types.CodeType:
    """Code that keeps its own frame. Its places have no columns, so that no line is marked below when it is printed."""
    tree = ast.parse("frame = sys._getframe()")
    for node in ast.walk(tree):
        if isinstance(node, (ast.stmt, ast.expr)):
            node.col_offset = node.end_col_offset = -1
    code: types.CodeType = compile(tree, "", "exec")
    return code


_FRAME_MAKER = _frame_maker()


def _traceback(frames: tuple[RemoteFrame, ...]) -> Optional[types.TracebackType]:
    """A traceback that prints these frames."""
    traceback = None
    for file, function, line in reversed(frames):
        names: dict[str, Any] = {"sys": sys}
        place = _FRAME_MAKER.replace(co_filename=safe_text(file), co_name=safe_text(function), co_firstlineno=line)
        exec(place, names)
        frame = names.pop("frame")
        traceback = types.TracebackType(traceback, frame, frame.f_lasti, line)
    return traceback
