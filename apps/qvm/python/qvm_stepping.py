"""Going on from a prompt line by line, and looking at the frames around it. See step() and up() in qvm."""

import bdb
import linecache
import sys

import _qvm

# Lines before and after the current one that are listed.
_AROUND = 5


def is_engine(frame):
    """Whether there is no frame of the user's code."""
    return frame is None or frame.f_code.co_filename == "<qvm>"


def place(frame):
    """Function, file and line, and the source line where it is known."""
    code = frame.f_code
    line = linecache.getline(code.co_filename, frame.f_lineno or 0).strip()
    return f"{code.co_name} ({code.co_filename}:{frame.f_lineno})\n" + (f"    {line}\n" if line else "")


class Stepper(bdb.Bdb):
    """Runs code up to its next stop, where stop_in(frame) says how it goes on: by a step, by the next line of a frame,
    or freely."""

    def __init__(self, stop_in):
        super().__init__()
        self._stop_in = stop_in
        self._tracer = sys.gettrace()

    def start(self, stop):
        """From the prompt that was in the code."""
        self.reset()
        frame = stop.frame
        while not is_engine(frame):
            frame.f_trace = self.trace_dispatch
            self.botframe = frame
            frame = frame.f_back
        self._go_on(stop)

    def _go_on(self, stop):
        if stop.way == "step":
            self.set_step()
        else:
            self.set_next(stop.frame)
            stop.frame.f_trace = self.trace_dispatch
        sys.settrace(self.trace_dispatch)

    def user_line(self, frame):
        """Called by bdb at a line where the code is to stop."""
        sys.settrace(None)
        if not _qvm.can_debug():
            sys.settrace(self._tracer)
            return
        # Code at the prompt may be stepped through as well.
        stop = sys.call_tracing(self._stop_in, (frame,))
        if stop.way:
            self._go_on(stop)
        else:
            sys.settrace(self._tracer)

    def stop_here(self, frame):
        """Called by bdb: not in the engine, nor in the machinery of imports."""
        return not frame.f_code.co_filename.startswith(("<qvm>", "<frozen ")) and super().stop_here(frame)

    def dispatch_call(self, frame, arg):
        """Called by bdb for each call. What the engine itself calls is no longer the code that was stopped."""
        if is_engine(frame) and is_engine(frame.f_back):
            sys.settrace(self._tracer)
            return None
        return super().dispatch_call(frame, arg)


def go_up(stop):
    if is_engine(stop.frame.f_back):
        raise RuntimeError("This is the outermost frame of the code that is held up.")
    stop.inner.append(stop.frame)
    stop.frame = stop.frame.f_back
    _qvm.show(place(stop.frame))


def go_down(stop):
    if not stop.inner:
        raise RuntimeError("This is the innermost frame: the code is held up here.")
    stop.frame = stop.inner.pop()
    _qvm.show(place(stop.frame))


def show_lines(stop):
    code, current = stop.frame.f_code, stop.frame.f_lineno or 0
    lines = linecache.getlines(code.co_filename)
    first = max(current - _AROUND, 1)
    for number, line in enumerate(lines[first - 1:current + _AROUND], first):
        line = line.rstrip("\n")
        _qvm.show(f"{number:5} {'->' if number == current else '  '} {line}".rstrip() + "\n")
    if not lines:
        _qvm.show(f"There is no source of {code.co_filename}.\n")


def show_stack(stop):
    frames = []
    frame = (stop.inner or [stop.frame])[0]
    while not is_engine(frame):
        frames.append(frame)
        frame = frame.f_back
    for frame in reversed(frames):
        _qvm.show(("> " if frame is stop.frame else "  ") + place(frame))
