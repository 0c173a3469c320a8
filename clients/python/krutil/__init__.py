"""A client of krutil engines: evaluates Python code and calls functions with NumPy arrays in another process, on this
machine or at the far end of an `ssh`.

>>> with krutil.start() as session:
...     session.eval("x = 6 * 7; x").value
'42'
"""

from . import aio
from .displays import Display, DisplayLine
from .errors import Aborted, Cancelled, Error, Lost, Refused, RemoteError, RemoteFrame
from .pool import Pool
from .prompts import Prompt, Question
from .requests import CancelAnswer, Request, Result, State, Text, Value, Warned
from .session import Session, connect, start
from .shared import empty
from .wire import Limits

# Tracebacks name an exception by the module in which users find it.
for _each in (Aborted, Cancelled, Error, Lost, Refused, RemoteError):
    _each.__module__ = __name__

__all__ = ["Aborted", "CancelAnswer", "Cancelled", "Display", "DisplayLine", "Error", "Limits", "Lost", "Pool",
           "Prompt", "Question", "Refused", "RemoteError", "RemoteFrame", "Request", "Result", "Session", "State",
           "Text", "Value", "Warned", "aio", "connect", "empty", "start"]
