"""Completion of code. See complete() in qvm."""

import os
import sys
from itertools import islice
from keyword import kwlist as _keywords
from types import ModuleType

from qvm_look import (ABSENT, MAX_ENTRIES, attribute, attribute_names, column_names, entries, field_names, function_of,
                      is_exactly, is_one_of, look_up, own_names, text_signature)
from qvm_reading import Reading

_MAX_CANDIDATES = 1000
# No more files of one directory are looked at.
_MAX_FILES = 10_000


def complete(text, cursor, scopes):
    """Begin and end of what is replaced, and the candidates. scopes are namespaces, from the innermost."""
    reading = Reading(text[:cursor])
    begin, found = _complete(reading, text[:cursor], scopes)
    # A candidate is one line, and is there once, so that a single one is taken at once.
    found = list(islice((each for each in dict.fromkeys(found) if each.isprintable()), _MAX_CANDIDATES))
    # Those that close a text take the place of its closing quotes.
    closes = reading.inside and found and found[0].endswith(reading.inside) and text.startswith(reading.inside, cursor)
    return begin, cursor + len(reading.inside) if closes else cursor, found


def _complete(reading, code, scopes):
    tokens, at = reading.tokens, len(reading.tokens)
    if reading.inside == "comment":
        return len(code), []
    if reading.inside:
        token = tokens[-1]
        if reading.sign(at - 2) == "[" and reading.has_value_before(at - 2):
            keys = _keys(reading.value_before(at - 2, scopes))
            return token.begin, [key for key in _written(keys, reading.inside) if key.startswith(token.text)]
        return _files(code, token.begin + token.text.index(reading.inside) + len(reading.inside))
    prefix = tokens[-1].text if at and tokens[-1].kind == "word" and not code[-1].isspace() else ""
    if prefix[:1].isdigit() and reading.sign(at - 2) != "[":
        return len(code), []
    at -= bool(prefix)
    begin = len(code) - len(prefix)
    words = [token.text for token in reading.statement()]
    if words and words[0] in ("import", "from") and len(words) > bool(prefix):
        return begin, _matching(prefix, _importable(words[:len(words) - bool(prefix)]))
    if reading.sign(at - 1) == ".":
        value = reading.value_before(at - 1, scopes)
        return begin, [] if value is ABSENT else _matching(prefix, attribute_names(value))
    if at and tokens[at - 1].text in ("def", "class", "as"):
        return begin, []
    first = []
    if reading.sign(at - 1) == "[" and reading.has_value_before(at - 1):
        keys = _keys(reading.value_before(at - 1, scopes))
        first = [key for key in _written(keys, "'") if key.startswith(prefix)]
    elif reading.open and reading.sign(at - 1) in ("(", ","):
        opening = reading.open[-1]
        if reading.sign(opening) == "(" and reading.has_value_before(opening):
            first = _matching(prefix, _keywords_of(reading.value_before(opening, scopes)))
    if not prefix and (first or not code.rpartition("\n")[2].strip()):
        return begin, first
    if at and not prefix and not code[-1].isspace() and reading.has_value_before(at):
        return begin, []
    names = {name for names in scopes for name, value in entries(names)}
    return begin, first + _matching(prefix, names.union(_keywords))


def _matching(prefix, names):
    """Those that begin with the prefix, in order; names with an underscore only if it has one."""
    return sorted(name for name in names if name.startswith(prefix) and (prefix or not name.startswith("_")))


def _keys(thing):
    """The keys of a subscript that can be written as literals."""
    if is_one_of(thing, list, tuple):
        return range(min(len(thing), _MAX_CANDIDATES))
    if type(thing) is dict:
        return [key for key in islice(thing, MAX_ENTRIES) if is_one_of(key, str, int)]
    if is_exactly(thing, "numpy", "ndarray"):
        return field_names(thing)
    return column_names(thing)


def _written(keys, quote):
    """The keys as code; texts in the quotes that are there already."""
    for key in keys:
        if type(key) is not str:
            yield str(key)
        elif key.isprintable() and quote[0] not in key and "\\" not in key:
            yield quote + key + quote


def _keywords_of(thing):
    """The parameters that a call can name, each with its equals sign."""
    if thing is ABSENT:
        return []
    found = function_of(thing)
    if found is None:
        return [name + "=" for name in _named_in(text_signature(thing) or "")]
    function, filled = found
    code = function.__code__
    names = code.co_varnames[:code.co_argcount + code.co_kwonlyargcount]
    return [name + "=" for name in names[max(filled, code.co_posonlyargcount):] if name.isidentifier()]


def _named_in(signature):
    """The parameters of a text signature that a call can name."""
    names, depth, before = [], 0, ""
    for token in Reading(signature.replace("\n", " ")).tokens:
        if depth == 1 and before in ("(", ","):
            if token.text == "/":
                names.clear()
            elif token.kind == "word":
                names.append(token.text)
        if token.kind == "sign":
            depth += (token.text in "([{") - (token.text in ")]}")
        before = token.text
    return names


def _files(code, begin):
    """Names in the directory that the text before the cursor names."""
    directory, slash, name = code[begin:].rpartition("/")
    found = []
    try:
        if "\\" not in code[begin:]:
            with os.scandir(os.path.expanduser(directory + slash) or ".") as files:
                for file in islice(files, _MAX_FILES):
                    # Hidden ones only when they are asked for.
                    if file.name.startswith(name) and (name or not file.name.startswith(".")):
                        if not any(sign in file.name for sign in "\\'\""):
                            found.append(file.name + ("/" if file.is_dir() else ""))
    except (OSError, ValueError):
        pass
    return len(code) - len(name), sorted(found)


def _importable(words):
    """What may stand behind these words of an import statement."""
    if words[0] == "from" and "import" in words:
        at = words.index("import")
        module = "".join(words[1:at])
        if module.startswith("."):
            return []
        loaded = look_up(sys.modules, module)
        names = [name for name, value in entries(own_names(loaded))] if type(loaded) is ModuleType else []
        return [*names, *_modules_in(module)] if words[-1] in ("import", ",", "(") else []
    dotted = []
    while words[-1] == "." and len(words) > 2:
        dotted.insert(0, words[-2])
        words = words[:-2]
    if words[-1] not in ("from", "import", ","):
        return []
    return _modules_in(".".join(dotted))


def _modules_in(package):
    """Names of the modules in a package, or of all that can be imported; none of them is imported for it."""
    from importlib.machinery import all_suffixes
    names = set()
    if not package:
        names.update(sys.builtin_module_names)
    before = package and package + "."
    names.update(name[len(before):] for name, value in entries(sys.modules)
                 if name.startswith(before) and "." not in name[len(before):])
    for directory in _directories(package):
        try:
            with os.scandir(directory or ".") as files:
                for file in islice(files, _MAX_FILES):
                    name = next((file.name[:-len(suffix)] for suffix in all_suffixes() if file.name.endswith(suffix)),
                                file.name if file.is_dir() else "")
                    name = name.partition(".")[0]
                    if name.isidentifier() and name not in ("__init__", "__main__", "__pycache__"):
                        names.add(name)
        except OSError:
            pass
    return names


def _directories(package):
    """The directories that hold the modules of a package."""
    directories = sys.path
    if package:
        loaded = look_up(sys.modules, package)
        if type(loaded) is ModuleType:
            directories = look_up(own_names(loaded), "__path__")
            if type(directories) is not list and directories is not ABSENT:
                directories = attribute(directories, "_path")  # of a namespace package
        else:
            outer, _, name = package.rpartition(".")
            directories = [os.path.join(each, name) for each in _directories(outer)]
    return [each for each in directories if type(each) is str] if type(directories) is list else []
