"""What the engine offers to the code that it runs.

Names without an underscore are for that code; the others are the engine's own.

Only modules that are quick to import are imported here, since every session waits for that. The others are imported
where they are first needed.
"""

import atexit as _atexit
import builtins as _builtins
import codecs as _codecs
import gc as _gc
import io as _io
import os as _os
import posix as _posix
import sys as _sys
import time as _time
import warnings as _warnings
import _signal
import _warnings as _c_warnings
from _collections import OrderedDict as _OrderedDict
from errno import EINVAL as _EINVAL
from os import path as _path
from os import strerror as _strerror
from _frozen_importlib_external import PathFinder as _PathFinder
from _operator import index as _index
from _thread import _local as _Local

import _qvm


def link(text, target):
    """Text that a terminal shows as a hyperlink to target; plain text where the output has no links."""
    text, target = str(text), str(target)
    if not _qvm.makes_links():
        return text
    # A control character would end the markup early.
    target = "".join(c if c.isprintable() and c != " " else "".join(f"%{b:02X}" for b in c.encode("utf-8", "replace"))
                     for c in target)
    return f"\x1b]8;;{target}\x1b\\{text}\x1b]8;;\x1b\\"


class _TextStream(_io.TextIOBase):
    """sys.stdout or sys.stderr: hands text to the engine, which sends it to the client."""

    encoding = "utf-8"
    errors = "replace"
    newlines = None
    line_buffering = True
    write_through = False
    mode = "w"

    def __init__(self, name, descriptor, write):
        self.name = name
        self._descriptor = descriptor
        self.write = write
        self.flush = _qvm.flush
        self.buffer = _ByteStream(self)

    def writable(self):
        return True

    def fileno(self):
        # Of the plain descriptor, so that child processes can be given it.
        return self._descriptor

    def reconfigure(self, **options):
        """Accepted for programs that ask for UTF-8 or line buffering, which this stream has anyway."""

    def close(self):
        self.flush()

    def __repr__(self):
        return f"<engine stream {self.name}>"


class _ByteStream(_io.BufferedIOBase):
    """The buffer attribute of a text stream: bytes that are UTF-8 text."""

    mode = "wb"

    def __init__(self, text):
        self.name = text.name
        self._text = text
        self._decoder = _codecs.getincrementaldecoder("utf-8")("replace")

    def writable(self):
        return True

    def write(self, data):
        data = bytes(memoryview(data))
        self._text.write(self._decoder.decode(data))
        return len(data)

    def flush(self):
        self._text.flush()

    def fileno(self):
        return self._text.fileno()

    def close(self):
        self.flush()


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
    for kind in type(value).__mro__:
        names = kind.__dict__
        if "_repr_png_" in names or "_repr_svg_" in names or "_repr_html_" in names:
            import qvm_displays
            qvm_displays.offer(value)
            break


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


class _InputStream(_io.TextIOBase):
    """sys.stdin: asks the client for lines."""

    encoding = "utf-8"
    errors = "replace"
    newlines = None
    line_buffering = True
    mode = "r"
    name = "<stdin>"

    def __init__(self):
        self._rest = ""

    def readable(self):
        return True

    def fileno(self):
        return 0

    def readline(self, size=-1):
        if size == 0:
            return ""
        if not self._rest:
            self._rest = _qvm.read_line()
        end = self._rest.find("\n") + 1 or len(self._rest)
        if size is not None and 0 < size < end:
            end = size
        line, self._rest = self._rest[:end], self._rest[end:]
        return line

    def read(self, size=-1):
        # Fewer characters than asked for, as from a terminal.
        return "".join(iter(self.readline, "")) if size is None or size < 0 else self.readline(size)

    def reconfigure(self, **options):
        """As for the other streams."""

    def close(self):
        """The client cannot be closed from here."""

    def __repr__(self):
        return "<engine stream <stdin>>"


class DebuggerQuit(BaseException):
    """Ends a request whose debug or keyboard prompt was left with dbquit()."""


class _Stop:
    """A prompt that holds code up. frame is where it evaluates, None for the session's namespace; inner are the frames
    that up() has left, the innermost first; way is how the code goes on: None for freely."""

    __slots__ = "frame", "inner", "way"

    def __init__(self, frame):
        self.frame, self.inner, self.way = frame, [], None


# Of the open prompts for commands, the innermost last.
_stops = []
_session_names = _sys.modules["__main__"].__dict__


def _take_commands(prompt, stop):
    """Whether the client could be asked to the end."""
    _stops.append(stop)
    try:
        end = prompt(stop)
    finally:
        _stops.pop()
    if end == "quit":
        raise DebuggerQuit("The debugger was left with quit.")
    if end == "exit":
        raise SystemExit
    return end != "withdrawn"


def _breakpoint(*arguments, **options):
    """sys.breakpointhook: opens a debug prompt in the code that called breakpoint()."""
    frame = _sys._getframe(1)
    if not _qvm.can_debug():
        _warn("breakpoint() goes on: the client or the engine has no debugger here", RuntimeWarning, 2)
        return
    _step_on(_stop_in(frame))


def _stop_in(frame):
    """Opens a debug prompt in the frame; returns how the code goes on."""
    import qvm_stepping
    stop = _Stop(frame)
    _qvm.show("Stopped in " + qvm_stepping.place(frame))
    if not _take_commands(_qvm.debug_prompt, stop):
        _warn("breakpoint() goes on: the client has no debugger any more", RuntimeWarning, 3)
    return stop


def _step_on(stop):
    if stop.way:
        import qvm_stepping
        qvm_stepping.Stepper(_stop_in).start(stop)


def keyboard():
    """Holds the running code up and evaluates what the client sends, where keyboard() was called, until dbcont()."""
    if not _qvm.can_ask():
        _warn("qvm.keyboard() goes on: the client cannot be asked", RuntimeWarning, 2)
        return
    stop = _Stop(_sys._getframe(1))
    if not _take_commands(_qvm.keyboard_prompt, stop):
        _warn("qvm.keyboard() goes on: the client cannot be asked any more", RuntimeWarning, 2)
    _step_on(stop)


def pause(seconds=None):
    """Holds the running code up until the client says to go on, or for so many seconds."""
    if seconds is not None:
        seconds = float(seconds)
    begin = _time.monotonic()
    _stops.append(_Stop(None))
    try:
        way_out = _qvm.pause_prompt(seconds) if _qvm.can_ask() else "withdrawn"
    finally:
        _stops.pop()
    if way_out == "exit":
        raise SystemExit
    if way_out == "withdrawn" and seconds is None:
        _warn("qvm.pause() goes on: the client cannot be asked", RuntimeWarning, 2)
    elif way_out == "withdrawn":
        _time.sleep(max(begin + seconds - _time.monotonic(), 0))


def dbcont():
    """At a prompt: lets the code that was held up go on, once this request has ended."""
    _qvm.leave_prompt(False)


def dbquit():
    """At a prompt: ends the code that was held up, once this request has ended."""
    _qvm.leave_prompt(True)


def _stopped():
    if not _stops or _stops[-1].frame is None:
        raise RuntimeError("no debug or keyboard prompt is open")
    return _stops[-1]


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


# Frames of a warning's stack; the innermost are kept.
_MAX_FRAMES = 200


def _stack(frame):
    """File, function and line of the frames of user code, from the outermost to this one."""
    prompts = (_take_commands.__code__, pause.__code__, _InputStream.readline.__code__)
    frames = []
    while frame is not None and len(frames) < _MAX_FRAMES:
        code = frame.f_code
        if code in prompts:
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
        _sys.stderr.write(f"{identifier}: {message}\n")
    else:
        _qvm.issue_warning(identifier, format, [_plain(each) for each in arguments], message,
                           _stack(_sys._getframe(1)), False)


def _plain(value):
    import numbers
    if isinstance(value, numbers.Integral):
        return int(value)
    if isinstance(value, numbers.Real):
        return float(value)
    return str(value)


# The warning that warnings.warn() or warn_explicit() of this thread is about to let through, as a list that gets it.
_issuing = _Local()
_show_warning = _warnings._showwarnmsg
_print_warning = _warnings._showwarnmsg_impl


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


def _on_shown(message):
    """warnings._showwarnmsg: what a filter lets through comes here."""
    taken = (_warnings.showwarning is not _warnings._showwarning_orig
             or _warnings._showwarnmsg_impl is not _print_warning)
    if taken or _qvm.is_apart():
        _show_warning(message)
    lets_through = getattr(_issuing, "shown", None)
    if lets_through is not None:
        lets_through.append(not taken)
    elif not _qvm.is_apart():
        # C code has raised it. Its place is that of a frame, or of code that is being compiled.
        frame = _sys._getframe(1)
        while frame is not None and (frame.f_code.co_filename != message.filename or frame.f_lineno != message.lineno):
            frame = frame.f_back
        stack = _stack(frame or _sys._getframe(1))
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


def _warn(message, category=None, stacklevel=1, source=None):
    """warnings.warn"""
    level = max(_index(stacklevel), 1)
    # Three frames of this module lie between the caller and Python's own function.
    shown = _raise_warning(lambda: _c_warnings.warn(message, category, level + 3, source))
    if _qvm.is_apart():
        return
    frame = _sys._getframe(1)
    while level > 1 and frame is not None:
        frame = frame.f_back
        level -= 1
    _issue(message, category, _stack(frame), shown)


def _warn_explicit(message, category, filename, lineno, *arguments, **options):
    """warnings.warn_explicit"""
    shown = _raise_warning(lambda: _c_warnings.warn_explicit(message, category, filename, lineno, *arguments,
                                                             **options))
    if not _qvm.is_apart():
        _issue(message, category, [*_stack(_sys._getframe(1)), (str(filename), "", min(max(lineno, 0), 0xFFFFFFFF))],
               shown)


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
        raise OSError(_EINVAL, _strerror(_EINVAL))
    before = _set_handler(signalnum, handler)
    if not callable(handler):
        _qvm.keep_last_words()
    return before


def _set_user_mask(how, mask):
    return _set_mask(how, [each for each in mask if each != _qvm.interrupt_signal])


# Sources of evaluated code, for tracebacks and inspection: the newest, by number and by length.
_MAX_SOURCES = 1000
_MAX_SOURCE_LENGTH = 16 << 20
_source_lengths = _OrderedDict()  # a plain one is searched for its first entry
_source_length = 0
# What linecache.cache is, once that module is imported.
_source_lines = {}


def _remember(filename, source):
    global _source_length
    _source_length -= _source_lengths.pop(filename, 0)
    _source_lengths[filename] = len(source)
    _source_length += len(source)
    while len(_source_lengths) > _MAX_SOURCES or _source_length > _MAX_SOURCE_LENGTH:
        oldest, length = _source_lengths.popitem(last=False)
        _source_length -= length
        _source_lines.pop(oldest, None)
    if filename in _source_lengths:
        # Without a modification time an entry is never looked up in the file system.
        _source_lines[filename] = (len(source), None, source.splitlines(True), filename)


# Keywords that only statements begin with.
_STATEMENTS = frozenset(("assert", "break", "class", "continue", "def", "del", "for", "from", "global", "if", "import",
                         "nonlocal", "pass", "raise", "return", "try", "while", "with"))


def _is_statement(line):
    """Whether the begin of a line shows that it is one statement and no expression, if it is well-formed at all."""
    if ";" in line or "\r" in line:
        return False
    name, equals, value = line.partition("=")
    if equals and not value.startswith("=") and name.strip().isidentifier():
        return True
    words = line.split(None, 1)
    return bool(words) and words[0] in _STATEMENTS


# ast.PyCF_ALLOW_TOP_LEVEL_AWAIT: code that awaits at its top level becomes a coroutine.
_AWAITS = 0x2000


def _run_to_end(coroutine):
    """The value of code that awaits."""
    import qvm_loop
    return qvm_loop.run_to_end(coroutine)


def _compile_block(source, filename):
    """Code of the statements and of a trailing expression; either may be None."""
    if "\n" not in source.rstrip():
        if _is_statement(source):
            # Quicker than to try it as an expression, and to look at its tree then.
            return _compile_program(source, filename)
        expression = _qvm.compile_expression(source, filename)
        if expression is not None:
            return None, expression
    import _ast
    tree = compile(source, filename, "exec", _ast.PyCF_ONLY_AST, True)
    if not tree.body or not isinstance(tree.body[-1], _ast.Expr):
        return compile(tree, filename, "exec", _AWAITS, True), None
    last = compile(_ast.Expression(tree.body.pop().value), filename, "eval", _AWAITS, True)
    return compile(tree, filename, "exec", _AWAITS, True) if tree.body else None, last


def _compile_program(source, filename):
    return compile(source, filename, "exec", _AWAITS, True), None


def _compile_statement(source, filename):
    import _ast
    tree = compile(source + "\n", filename, "single", _ast.PyCF_ONLY_AST, True)
    if len(tree.body) != 1:
        second = tree.body[1]
        raise SyntaxError("multiple statements found while compiling a single statement",
                          (filename, second.lineno, second.col_offset + 1, None))
    return compile(tree, filename, "single", _AWAITS, True), None


# By code type; one that is not stated is a block.
_COMPILERS = (_compile_block, _compile_program, _compile_statement, _compile_block)


# What the engine has put at the begin of sys.path, as Python does for code (an empty text, the current directory) and
# for a file (its directory).
_path_entry = ""


def _begin_file(filename):
    """Lets code of a file find what it finds when Python runs the file. It stays until the next file."""
    global _path_entry
    _sys.modules["__main__"].__file__ = filename
    if _sys.flags.safe_path:
        return
    directory = _path.dirname(_path.realpath(filename))
    if _sys.path[:1] == [_path_entry]:
        _sys.path[0] = directory
    else:
        _sys.path.insert(0, directory)
    _path_entry = directory


def _compile(source, filename, code_type, begins_file):
    if begins_file:
        _begin_file(filename)
    _remember(filename, source)
    return _COMPILERS[code_type](source, filename)


def _scopes():
    """The namespaces in which code finds its names now, from the innermost."""
    frame = _stops[-1].frame if _stops else None
    if frame is None:
        return [_session_names, _builtins.__dict__]
    return [frame.f_locals, frame.f_globals, frame.f_builtins]


def complete(text, cursor):
    """Begin and end of the name at the cursor, and what may stand there instead, one candidate a line.

    text is code as it is typed, cursor a place in it, as a number of characters. Each candidate replaces
    text[begin:end]. At a prompt, names are those of the code that the prompt holds up. No code of the user's runs for
    it: what only a property, a call, __getattr__ or __dir__ could tell is left out. There are 1,000 candidates at most.

    >>> qvm.complete("import itert", 12)
    (7, 12, 'itertools')
    """
    import qvm_completion
    begin, end, candidates = qvm_completion.complete(text, max(0, min(_index(cursor), len(text))), _scopes())
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
    return qvm_inspection.inspect(text, max(0, min(_index(cursor), len(text))), _scopes())


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
    _sys.path.insert(0, _path_entry)
_sys.stdout = _sys.__stdout__ = _TextStream("<stdout>", 1, _qvm.write_output)
_sys.stderr = _sys.__stderr__ = _TextStream("<stderr>", 2, _qvm.write_error)
_qvm.gather_prints(_sys.stdout)
_sys.displayhook = _sys.__displayhook__ = _show
_sys.stdin = _sys.__stdin__ = _InputStream()
_sys.breakpointhook = _sys.__breakpointhook__ = _breakpoint
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
_warnings._showwarnmsg = _on_shown
_replace(_warnings, "warn", _warn)
_replace(_warnings, "warn_explicit", _warn_explicit)


def _adapt_linecache(linecache):
    _source_lines.update(linecache.cache)
    linecache.cache = _source_lines


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
