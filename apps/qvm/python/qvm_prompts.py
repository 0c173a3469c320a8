"""Prompts that hold running code up, and what code and people do there. qvm offers what has no underscore."""

import builtins
import sys
import time

import _qvm
from qvm_warnings import held_up, warn


class DebuggerQuit(BaseException):
    """Ends a request whose debug or keyboard prompt was left with dbquit()."""


class Stop:
    """A prompt that holds code up. frame is where it evaluates, None for the session's namespace; inner are the frames
    that up() has left, the innermost first; way is how the code goes on: None for freely."""

    __slots__ = "frame", "inner", "way"

    def __init__(self, frame):
        self.frame, self.inner, self.way = frame, [], None


# Of the open prompts for commands, the innermost last.
stops = []
session_names = sys.modules["__main__"].__dict__


def _take_commands(prompt, stop):
    """Whether the client could be asked to the end."""
    stops.append(stop)
    try:
        end = prompt(stop)
    finally:
        stops.pop()
    if end == "quit":
        raise DebuggerQuit("The debugger was left with quit.")
    if end == "exit":
        raise SystemExit
    return end != "withdrawn"


def on_breakpoint(*arguments, **options):
    """sys.breakpointhook: opens a debug prompt in the code that called breakpoint()."""
    frame = sys._getframe(1)
    if not _qvm.can_debug():
        warn("breakpoint() goes on: the client or the engine has no debugger here", RuntimeWarning, 2)
        return
    _step_on(_stop_in(frame))


def _stop_in(frame):
    """Opens a debug prompt in the frame; returns how the code goes on."""
    import qvm_stepping
    stop = Stop(frame)
    _qvm.show("Stopped in " + qvm_stepping.place(frame))
    if not _take_commands(_qvm.debug_prompt, stop):
        warn("breakpoint() goes on: the client has no debugger any more", RuntimeWarning, 3)
    return stop


def _step_on(stop):
    if stop.way:
        import qvm_stepping
        qvm_stepping.Stepper(_stop_in).start(stop)


def keyboard():
    """Holds the running code up and evaluates what the client sends, where keyboard() was called, until dbcont()."""
    if not _qvm.can_ask():
        warn("qvm.keyboard() goes on: the client cannot be asked", RuntimeWarning, 2)
        return
    stop = Stop(sys._getframe(1))
    if not _take_commands(_qvm.keyboard_prompt, stop):
        warn("qvm.keyboard() goes on: the client cannot be asked any more", RuntimeWarning, 2)
    _step_on(stop)


def pause(seconds=None):
    """Holds the running code up until the client says to go on, or for so many seconds."""
    if seconds is not None:
        seconds = float(seconds)
    begin = time.monotonic()
    stops.append(Stop(None))
    try:
        way_out = _qvm.pause_prompt(seconds) if _qvm.can_ask() else "withdrawn"
    finally:
        stops.pop()
    if way_out == "exit":
        raise SystemExit
    if way_out == "withdrawn" and seconds is None:
        warn("qvm.pause() goes on: the client cannot be asked", RuntimeWarning, 2)
    elif way_out == "withdrawn":
        time.sleep(max(begin + seconds - time.monotonic(), 0))


def dbcont():
    """At a prompt: lets the code that was held up go on, once this request has ended."""
    _qvm.leave_prompt(False)


def dbquit():
    """At a prompt: ends the code that was held up, once this request has ended."""
    _qvm.leave_prompt(True)


def _stopped():
    if not stops or stops[-1].frame is None:
        raise RuntimeError("no debug or keyboard prompt is open")
    return stops[-1]


def _step(way):
    stop = _stopped()
    _qvm.leave_prompt(False)
    stop.way = way


def step():
    """At a prompt: lets the code go on up to the next line, also in a function that it calls; a debug prompt opens
    there.

    >>> qvm.step()
    """
    _step("step")


def next():
    """At a prompt: lets the code go on up to the next line of the frame, or of its caller when it returns; a debug
    prompt opens there.

    >>> qvm.next()
    """
    _step("next")


def up():
    """At a prompt: code is evaluated in the caller's frame from now on.

    >>> qvm.up()
    """
    import qvm_stepping
    qvm_stepping.go_up(_stopped())


def down():
    """At a prompt: takes one up() back.

    >>> qvm.down()
    """
    import qvm_stepping
    qvm_stepping.go_down(_stopped())


def list():
    """At a prompt: shows the lines around the one where the frame is.

    >>> qvm.list()
    """
    import qvm_stepping
    qvm_stepping.show_lines(_stopped())


def where():
    """At a prompt: shows the frames of the code that is held up, the outermost first; the one in which code is
    evaluated is marked.

    >>> qvm.where()
    """
    import qvm_stepping
    qvm_stepping.show_stack(_stopped())


def debugger(on=True):
    """States whether this engine offers a debugger; without, breakpoint() goes on."""
    _qvm.set_debugging(bool(on))


def scopes():
    """The namespaces in which code finds its names now, from the innermost."""
    frame = stops[-1].frame if stops else None
    if frame is None:
        return [session_names, builtins.__dict__]
    return [frame.f_locals, frame.f_globals, frame.f_builtins]


held_up.extend((_take_commands.__code__, pause.__code__))
