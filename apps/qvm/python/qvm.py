"""What the engine offers to the code that it runs.

Names without an underscore are for that code; the others are the engine's own, and so are the modules qvm_*.

Only modules that are quick to import are imported here, since every session waits for that. The others are imported
where they are first needed.
"""

import atexit as _atexit
import builtins as _builtins
import gc as _gc
import io as _io
import os as _os
import posix as _posix
import sys as _sys
import warnings as _warnings
import _signal
from os import path as _path
from _frozen_importlib_external import PathFinder as _PathFinder
from _operator import index as _index

import _qvm
import qvm_code as _code
import qvm_prompts as _prompts
import qvm_streams as _streams
import qvm_warnings as _issued
from qvm_code import compile_code as _compile
from qvm_prompts import (DebuggerQuit, dbcont, dbquit, debugger, down, keyboard, list, next, pause, step, up, where)
from qvm_warnings import warning

# What code may use says that it is from here, whichever of the engine's files it is in.
for _each in [value for name, value in globals().items() if not name.startswith("_")]:
    _each.__module__ = __name__


def link(text, target):
    """Text that a terminal shows as a hyperlink to target; plain text where the output has no links."""
    text, target = str(text), str(target)
    if not _qvm.makes_links():
        return text
    # A control character would end the markup early.
    target = "".join(c if c.isprintable() and c != " " else "".join(f"%{b:02X}" for b in c.encode("utf-8", "replace"))
                     for c in target)
    return f"\x1b]8;;{target}\x1b\\{text}\x1b]8;;\x1b\\"


def _show(value):
    """sys.displayhook: shows the value of an expression to the client."""
    if value is None:
        return
    # As Python's own hook does, so that a __repr__ that uses it finds no half-made value.
    _builtins._ = None
    plain = not _shown_elements and not _qvm.formats_values()
    _qvm.show((repr(value) if plain else _text_of(value, _shown_elements)) + "\n")
    if id(type(value)) not in _PLAIN_TYPES:
        _offer_forms(value)
    _builtins._ = value


# Types of which everybody knows that their values have no other form than text, by identity: a type of the user may
# have a hash and an equality of its own.
_PLAIN_TYPES = frozenset(map(id, (bool, int, float, complex, str, bytes, list, tuple, dict, set, frozenset)))


def _offer_forms(value):
    """Whether the client has been offered any."""
    for kind in type(value).__mro__:
        names = kind.__dict__
        if "_repr_png_" in names or "_repr_svg_" in names or "_repr_html_" in names:
            import qvm_displays
            return qvm_displays.offer(value)
    return False


# As many elements of each container are shown; 0 for all.
_shown_elements = 0


def _text_of(value, limit):
    if limit:
        import qvm_values
        return qvm_values.text_of(value, limit, _qvm.formats_values())
    if _qvm.formats_values():
        import pprint
        return pprint.pformat(value)
    return repr(value)


def shorten(limit):
    """From now on, values are shown with at most limit elements of each list, tuple, set and dict; 0 shows all.

    What is left out is counted. print() and repr() are as ever.

    >>> qvm.shorten(2)
    >>> [10, 20, 30, 40]
    [10, 20, ... 2 more]
    """
    global _shown_elements
    limit = _index(limit)
    if limit < 0:
        raise ValueError(f"limit must be 0 or more, not {limit}")
    _shown_elements = limit


def full():
    """Shows the value that was shown last with all its elements.

    >>> qvm.shorten(2)
    >>> [10, 20, 30, 40]
    [10, 20, ... 2 more]
    >>> qvm.full()
    [10, 20, 30, 40]
    """
    value = _builtins.__dict__.get("_")
    if value is not None:
        _qvm.show(_text_of(value, 0) + "\n")


def bind_display():
    """Binds display() among the built-in names, as code in notebooks expects it."""
    _builtins.display = _display


def _display(*values):
    """Shows values where the code is: as pictures or tables where they are such, otherwise as text.

    >>> for frame in frames:
    ...     display(frame)
    """
    for value in values:
        figures = _sys.modules.get("matplotlib.figure")
        if figures is not None and isinstance(value, figures.Figure):
            import qvm_pictures
            shown = qvm_pictures.offer(value)
        else:
            shown = _offer_forms(value)
        if not shown:
            print(_text_of(value, _shown_elements))


_display.__name__ = _display.__qualname__ = "display"


def take_displays():
    """Hands over the pictures that are kept for the client, and forgets them. Clients call it after a request that has
    shown the line of a picture.

    Returns a text in JSON, a list with what there is of each picture, and an array of the bytes that it counts.

    >>> description, data = qvm.take_displays()
    """
    import qvm_displays
    return qvm_displays.take()


# What is called when a request has ended that no prompt holds, in the order in which it was added.
_at_end = []


def _end_request():
    for action in _at_end:
        action()


def _safe_string(value, what, func=str):
    """traceback._safe_string: as Python's own, but an interrupt ends the formatting."""
    try:
        return func(value)
    except KeyboardInterrupt:
        raise
    except:
        return f"<{what} {func.__name__}() failed>"


def _print_error(type, error, trace):
    """sys.excepthook: Python's own drops interrupts."""
    import traceback
    traceback.print_exception(type, error, trace)


def _hide_engine(report):
    """Takes the engine's frames out of a traceback.TracebackException and all that it refers to."""
    import traceback
    seen, waiting = set(), [report]
    while waiting:
        each = waiting.pop()
        if each is None or id(each) in seen:
            continue
        seen.add(id(each))
        frames = [frame for frame in each.stack or () if frame.filename != "<qvm>"]
        each.stack = traceback.StackSummary.from_list(frames) if frames else None
        waiting += [each.__cause__, each.__context__, *(each.exceptions or ())]


def _format_error(error, limit):
    """The text that Python prints for an uncaught error, cut after about limit characters."""
    import traceback
    # As many frames as Python's own printing shows.
    frames = getattr(_sys, "tracebacklimit", -1000)
    report = traceback.TracebackException(type(error), error, error.__traceback__, limit=frames, compact=True)
    _hide_engine(report)
    pieces, length = [], 0
    for piece in report.format():
        if length + len(piece) > limit:
            pieces += [piece[:limit - length], "\n... (the rest is left out)\n"]
            break
        pieces.append(piece)
        length += len(piece)
    return "".join(pieces)


# The signal that carries cancels is to code what SIGKILL is: it can be neither handled nor blocked.
def _set_user_handler(signalnum, handler):
    if signalnum == _qvm.interrupt_signal:
        from errno import EINVAL
        raise OSError(EINVAL, _os.strerror(EINVAL))
    before = _set_handler(signalnum, handler)
    if not callable(handler):
        _qvm.keep_last_words()
    return before


def _set_user_mask(how, mask):
    return _set_mask(how, [each for each in mask if each != _qvm.interrupt_signal])


def _run_to_end(coroutine):
    """The value of code that awaits."""
    import qvm_loop
    return qvm_loop.run_to_end(coroutine)


def complete(text, cursor):
    """Begin and end of the name at the cursor, and what may stand there instead, one candidate a line.

    text is code as it is typed, cursor a place in it, as a number of characters. Each candidate replaces
    text[begin:end]. At a prompt, names are those of the code that the prompt holds up. No code of the user's runs for
    it: what only a property, a call, __getattr__ or __dir__ could tell is left out. There are 1,000 candidates at most.

    >>> qvm.complete("import itert", 12)
    (7, 12, 'itertools')
    """
    import qvm_completion
    begin, end, candidates = qvm_completion.complete(text, max(0, min(_index(cursor), len(text))), _prompts.scopes())
    return begin, end, "\n".join(candidates)


def inspect(text, cursor):
    """Parameters and documentation of the name at the cursor, or of the function in whose call the cursor is.

    The result is empty when nothing is known. No code of the user's runs for it: defaults that only a __repr__ could
    show are dots.

    >>> print(qvm.inspect("divmod(7, 2", 11))
    divmod(x, y, /)
    <BLANKLINE>
    Return the tuple (x//y, x%y).  Invariant: div*y + mod == x.
    """
    import qvm_inspection
    return qvm_inspection.inspect(text, max(0, min(_index(cursor), len(text))), _prompts.scopes())


def is_complete(text):
    """Whether the code is "complete", "incomplete" or "invalid", and the indentation of a line that continues it.

    As at Python's own prompt, an indented block is complete when a line behind it is empty. Nothing runs.

    >>> qvm.is_complete("if x:")
    ('incomplete', '    ')
    """
    import qvm_inspection
    return qvm_inspection.is_complete(text)


def _after_sending(leave):
    """What leaves the program at once, with what it has printed sent before."""
    def send_and_leave(*arguments, **options):
        _qvm.send_all()
        return leave(*arguments, **options)
    return send_and_leave


def _finish():
    """What the end of a Python program does for its code: exit functions run, and written files are complete."""
    _atexit._run_exitfuncs()
    for file in _qvm.instances(_gc.get_objects(), (_io.TextIOWrapper, _io.BufferedWriter, _io.BufferedRandom)):
        try:
            if not file.closed:
                file.flush()
        except (OSError, ValueError):
            pass


def _prepare():
    """For a process that is forked for each session: imports what this module would import in many of them, and keeps
    all that there is where the garbage collector does not look, because looking would copy it in each of them."""
    import _ast, linecache, numbers, pprint, signal, traceback
    _qvm.flush()
    _gc.collect()
    _gc.freeze()


if not _sys.flags.safe_path:
    _sys.path.insert(0, _code.path_entry)
_sys.stdout = _sys.__stdout__ = _streams.TextStream("<stdout>", 1, _qvm.write_output)
_sys.stderr = _sys.__stderr__ = _streams.TextStream("<stderr>", 2, _qvm.write_error)
_qvm.gather_prints(_sys.stdout)
_sys.displayhook = _sys.__displayhook__ = _show
_sys.stdin = _sys.__stdin__ = _streams.InputStream()
_sys.breakpointhook = _sys.__breakpointhook__ = _prompts.on_breakpoint
_sys.excepthook = _sys.__excepthook__ = _print_error
_sys.unraisablehook = _qvm.on_unraisable


def _replace(module, name, function):
    """Puts a function into the place of a module's own, which is returned."""
    original = getattr(module, name)
    function.__name__ = function.__qualname__ = name
    function.__module__ = module.__name__
    function.__doc__ = original.__doc__
    setattr(module, name, function)
    return original


# The module signal calls these, whenever it is imported.
_set_handler = _replace(_signal, "signal", _set_user_handler)
_set_mask = _replace(_signal, "pthread_sigmask", _set_user_mask)
_set_handler(_qvm.interrupt_signal, _qvm.on_interrupt_signal)
for _name in "_exit", "execv", "execve":
    _replace(_posix, _name, _after_sending(getattr(_posix, _name)))
    setattr(_os, _name, getattr(_posix, _name))
_warnings._showwarnmsg = _issued.on_shown
_replace(_warnings, "warn", _issued.warn)
_replace(_warnings, "warn_explicit", _issued.warn_explicit)


def _adapt_linecache(linecache):
    _code.source_lines.update(linecache.cache)
    linecache.cache = _code.source_lines


def _adapt_traceback(traceback):
    traceback._safe_string = _safe_string


def _adapt_matplotlib(matplotlib):
    """Makes the engine's backend the one that is used when nobody has chosen another. What the package and the
    distribution say in their own files is nobody's choice."""
    try:
        from matplotlib import cbook, rcsetup
        parameters = matplotlib.rcParams
        if dict.get(parameters, "backend") is not rcsetup._auto_backend_sentinel:
            by_default = "/etc/matplotlibrc", _path.realpath(cbook._get_data_path("matplotlibrc"))
            if _os.environ.get("MPLBACKEND") or _path.realpath(matplotlib.matplotlib_fname()) not in by_default:
                return
        # Looking it up as others do would already choose one.
        dict.__setitem__(parameters, "backend", "module://qvm_pictures")
    except (ImportError, AttributeError):
        pass  # It is another package of this name, or a version that chooses in another way.


class _AdaptingFinder:
    """Finds modules that are changed as soon as they are imported."""

    changes = {"linecache": _adapt_linecache, "traceback": _adapt_traceback, "matplotlib": _adapt_matplotlib}

    @classmethod
    def find_spec(cls, name, path=None, target=None):
        change = cls.changes.get(name)
        spec = _PathFinder.find_spec(name, path, target) if change else None
        if spec is not None and spec.loader is not None:
            execute = spec.loader.exec_module

            def execute_and_change(module):
                execute(module)
                change(module)

            spec.loader.exec_module = execute_and_change
        return spec


_sys.meta_path.insert(0, _AdaptingFinder)
for _name, _change in _AdaptingFinder.changes.items():
    if _name in _sys.modules:
        _change(_sys.modules[_name])
