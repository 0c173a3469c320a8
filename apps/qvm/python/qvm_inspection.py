"""What the code at a cursor stands for, and whether it is complete. See inspect() and is_complete() in qvm."""

import re
import warnings
from _ast import PyCF_ONLY_AST
from codeop import PyCF_ALLOW_INCOMPLETE_INPUT, PyCF_DONT_IMPLY_DEDENT
from inspect import CO_VARARGS, CO_VARKEYWORDS, cleandoc
from types import FunctionType, GetSetDescriptorType, MethodType, ModuleType, NoneType

from qvm_look import (ABSENT, C_FUNCTIONS, class_attribute, function_of, is_class, is_one_of, look_up, own_names,
                      text_signature)
from qvm_reading import Reading

_PARSING = PyCF_ONLY_AST | PyCF_DONT_IMPLY_DEDENT | PyCF_ALLOW_INCOMPLETE_INPUT
_MAX_DEFAULT = 60
_HEAP_TYPE = 1 << 9

_flags = type.__dict__["__flags__"].__get__
_name = type.__dict__["__name__"].__get__


def inspect(text, cursor, scopes):
    cursor += re.compile(r"\w*").match(text, cursor).end() - cursor
    reading = Reading(text[:cursor])
    if reading.inside == "comment":
        return ""
    end = len(reading.tokens) - bool(reading.inside)
    value = ABSENT if reading.inside or text[:cursor][-1:].isspace() else reading.value_before(end, scopes)
    if value is ABSENT and reading.open and reading.sign(reading.open[-1]) == "(":
        # Inside a call, what is called.
        end = reading.open[-1]
        value = reading.value_before(end, scopes)
    if value is ABSENT:
        return ""
    last = reading.tokens[end - 1]
    name = last.text if last.kind == "word" else ""
    parameters = _parameters(value)
    head = f"{name or 'value'}: {_name(type(value))}" if parameters is None else name + parameters
    documentation = _documentation(value)
    return f"{head}\n\n{documentation}" if documentation else head


def _parameters(thing):
    """The parameters in brackets, with defaults whose text runs no code; None for what cannot be called so."""
    found = function_of(thing)
    if found is not None:
        return _python_parameters(*found)
    text = text_signature(thing)
    if text is not None:
        return re.sub(r"\$\w+(, /)?(, )?", "", text)
    return "(...)" if is_one_of(thing, *C_FUNCTIONS) or is_class(thing) else None


def _python_parameters(function, filled):
    code = function.__code__
    count, names = code.co_argcount, list(code.co_varnames)
    defaults = dict(zip(reversed(names[:count]), reversed(list(tuple.__iter__(function.__defaults__ or ())))))
    by_keyword = function.__kwdefaults__ or {}
    written = []
    for index in range(filled, count):
        written.append(names[index] + _default(defaults.get(names[index], ABSENT)))
        if index + 1 == code.co_posonlyargcount:
            written.append("/")
    keyword_only = names[count:count + code.co_kwonlyargcount]
    rest = names[count + code.co_kwonlyargcount:]
    if code.co_flags & CO_VARARGS:
        written.append("*" + rest.pop(0))
    elif keyword_only:
        written.append("*")
    written += [name + _default(look_up(by_keyword, name)) for name in keyword_only]
    if code.co_flags & CO_VARKEYWORDS:
        written.append("**" + rest.pop(0))
    return "(" + ", ".join(written) + ")"


def _default(value):
    if value is ABSENT:
        return ""
    if is_one_of(value, bool, bytes, complex, float, int, NoneType, str):
        try:
            text = repr(value)
        except ValueError:  # an int with very many digits
            text = ""
        if 0 < len(text) <= _MAX_DEFAULT:
            return "=" + text
    return "=..."


def _documentation(thing):
    while type(thing) is MethodType:
        thing = thing.__func__
    if is_one_of(thing, FunctionType, *C_FUNCTIONS):
        text = thing.__doc__
    elif type(thing) is ModuleType:
        text = look_up(own_names(thing), "__doc__")
    elif is_class(thing):
        text = class_attribute(thing, "__doc__")
    else:
        text = class_attribute(type(thing), "__doc__")
        if type(text) is GetSetDescriptorType and not _flags(type(thing)) & _HEAP_TYPE:
            text = text.__get__(thing)  # that of the instance, from a type in C
    return cleandoc(text) if type(text) is str else ""


def is_complete(text):
    """The state of the code, and the indentation of a line behind it."""
    state = _state(text)
    return state, _indentation(text) if state == "incomplete" else ""


def _state(text):
    if all(not line.strip() or line.lstrip().startswith("#") for line in text.split("\n")):
        return "complete"
    # What the parser warns of is said when the code runs. Python looks this name up for each warning.
    filters = warnings.filters
    warnings.filters = [("ignore", None, Warning, None, 0)]
    try:
        try:
            tree = compile(text, "<qvm>", "exec", _PARSING, True)
        except SyntaxError:
            compile(text + "\n", "<qvm>", "exec", _PARSING, True)
            return "incomplete"
        last = tree.body[-1]
        # A block goes on until an empty line.
        block = getattr(last, "body", None)
        ended = not block or block[0].lineno == last.lineno or not text.rpartition("\n")[2].strip()
        return "complete" if ended else "incomplete"
    except SyntaxError as error:
        return "incomplete" if "incomplete input" in str(error) else "invalid"
    except (MemoryError, OverflowError, RecursionError, ValueError):
        return "invalid"
    finally:
        warnings.filters = filters


def _indentation(text):
    reading = Reading(text)
    if reading.inside and reading.inside != "comment":
        return ""
    while reading.tokens[-1].text == "\n":
        reading.tokens.pop()
    statement, last = reading.statement(), reading.tokens[-1]
    # What goes on over several lines is as deep as the first of them.
    begin = text.rfind("\n", 0, (last if reading.open else statement[0]).begin) + 1
    blanks = re.compile(r"[^\S\n]*").match(text, begin).group()
    if last.text == ":" or (reading.open and last.text in ("(", "[", "{")):
        return blanks + "    "
    if not reading.open and statement[0].text in ("break", "continue", "pass", "raise", "return"):
        return blanks[:-4]
    return blanks
