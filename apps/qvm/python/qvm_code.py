"""How evaluated code is compiled, and what is kept of it for tracebacks."""

import sys
from _collections import OrderedDict
from os import path

import _qvm

# Sources of evaluated code, for tracebacks and inspection: the newest, by number and by length.
_MAX_SOURCES = 1000
_MAX_SOURCE_LENGTH = 16 << 20
_source_lengths = OrderedDict()  # a plain one is searched for its first entry
_source_length = 0
# What linecache.cache is, once that module is imported.
source_lines = {}


def _remember(filename, source):
    global _source_length
    _source_length -= _source_lengths.pop(filename, 0)
    _source_lengths[filename] = len(source)
    _source_length += len(source)
    while len(_source_lengths) > _MAX_SOURCES or _source_length > _MAX_SOURCE_LENGTH:
        oldest, length = _source_lengths.popitem(last=False)
        _source_length -= length
        source_lines.pop(oldest, None)
    if filename in _source_lengths:
        # Without a modification time an entry is never looked up in the file system.
        source_lines[filename] = (len(source), None, source.splitlines(True), filename)


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
path_entry = ""


def _begin_file(filename):
    """Lets code of a file find what it finds when Python runs the file. It stays until the next file."""
    global path_entry
    sys.modules["__main__"].__file__ = filename
    if sys.flags.safe_path:
        return
    directory = path.dirname(path.realpath(filename))
    if sys.path[:1] == [path_entry]:
        sys.path[0] = directory
    else:
        sys.path.insert(0, directory)
    path_entry = directory


def compile_code(source, filename, code_type, begins_file):
    if begins_file:
        _begin_file(filename)
    _remember(filename, source)
    return _COMPILERS[code_type](source, filename)
