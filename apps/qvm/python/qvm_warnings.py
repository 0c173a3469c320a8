"""Warnings, which go to the client with their stack, whether it has them printed or not."""

import sys
import warnings
import _warnings as _c_warnings
from _operator import index
from _thread import _local

import _qvm

# Frames of a warning's stack; the innermost are kept.
_MAX_FRAMES = 200

# The code of the functions in which a request is held up while the client's next ones run.
held_up = []


def _stack(frame):
    """File, function and line of the frames of user code, from the outermost to this one."""
    frames = []
    while frame is not None and len(frames) < _MAX_FRAMES:
        code = frame.f_code
        if code in held_up:
            break  # what lies beyond belongs to the request that the prompt holds up
        if code.co_filename != "<qvm>":
            frames.append((code.co_filename, code.co_name, frame.f_lineno or 0))
        frame = frame.f_back
    frames.reverse()
    return frames


def warning(identifier, format, *arguments):
    """Issues a warning to the client, with the text format % arguments. Without arguments the format is the text."""
    identifier, format = str(identifier), str(format)
    message = format % arguments if arguments else format
    if _qvm.is_apart():
        sys.stderr.write(f"{identifier}: {message}\n")
    else:
        _qvm.issue_warning(identifier, format, [_plain(each) for each in arguments], message,
                           _stack(sys._getframe(1)), False)


def _plain(value):
    import numbers
    if isinstance(value, numbers.Integral):
        return int(value)
    if isinstance(value, numbers.Real):
        return float(value)
    return str(value)


# The warning that warnings.warn() or warn_explicit() of this thread is about to let through, as a list that gets it.
_issuing = _local()
_show_warning = warnings._showwarnmsg
_print_warning = warnings._showwarnmsg_impl


def _issue(message, category, stack, shown):
    if isinstance(message, Warning):
        category = type(message)
    elif category is None:
        category = UserWarning
    identifier = type.__getattribute__(category, "__qualname__")
    module = type.__getattribute__(category, "__module__")
    if module != "builtins":
        identifier = f"{module}.{identifier}"
    text = str(message)
    _qvm.issue_warning(identifier, text, [], text, stack, not shown)


def on_shown(message):
    """warnings._showwarnmsg: what a filter lets through comes here."""
    taken = (warnings.showwarning is not warnings._showwarning_orig
             or warnings._showwarnmsg_impl is not _print_warning)
    if taken or _qvm.is_apart():
        _show_warning(message)
    lets_through = getattr(_issuing, "shown", None)
    if lets_through is not None:
        lets_through.append(not taken)
    elif not _qvm.is_apart():
        # C code has raised it. Its place is that of a frame, or of code that is being compiled.
        frame = sys._getframe(1)
        while frame is not None and (frame.f_code.co_filename != message.filename or frame.f_lineno != message.lineno):
            frame = frame.f_back
        stack = _stack(frame or sys._getframe(1))
        if frame is None:
            stack.append((message.filename, "", message.lineno))
        _issue(message.message, message.category, stack, not taken)


def _raise_warning(raise_it):
    """Whether a filter let the warning through and nobody took it."""
    before = getattr(_issuing, "shown", None)
    _issuing.shown = shown = []
    try:
        raise_it()
    finally:
        _issuing.shown = before
    return shown == [True]


def warn(message, category=None, stacklevel=1, source=None):
    """warnings.warn"""
    level = max(index(stacklevel), 1)
    # Three frames of this module lie between the caller and Python's own function.
    shown = _raise_warning(lambda: _c_warnings.warn(message, category, level + 3, source))
    if _qvm.is_apart():
        return
    frame = sys._getframe(1)
    while level > 1 and frame is not None:
        frame = frame.f_back
        level -= 1
    _issue(message, category, _stack(frame), shown)


def warn_explicit(message, category, filename, lineno, *arguments, **options):
    """warnings.warn_explicit"""
    shown = _raise_warning(lambda: _c_warnings.warn_explicit(message, category, filename, lineno, *arguments,
                                                             **options))
    if not _qvm.is_apart():
        _issue(message, category, [*_stack(sys._getframe(1)), (str(filename), "", min(max(lineno, 0), 0xFFFFFFFF))],
               shown)
