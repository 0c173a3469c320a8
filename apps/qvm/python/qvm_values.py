"""Text of values, with as many elements as are wanted. See shorten() in qvm."""

import sys
from itertools import islice
from pprint import PrettyPrinter

_KINDS = dict, frozenset, list, set, tuple


class _Rest:
    """Stands for elements that are left out."""

    def __init__(self, count):
        self._count = count

    def __repr__(self):
        return f"... {self._count:,} more"


class _Printer(PrettyPrinter):
    """Shows so many elements of each container of Python's own types. Subclasses, the user's, show themselves."""

    def __init__(self, limit, **options):
        super().__init__(**options)
        self._limit = limit

    def format(self, thing, context, maxlevels, level):
        """The text of a value that fits into a line; what is cut here is cut before it is put into words."""
        if not any(type(thing) is kind for kind in _KINDS) or len(thing) <= self._limit or id(thing) in context:
            return super().format(thing, context, maxlevels, level)
        rest = _Rest(len(thing) - self._limit)
        shorter = type(thing)(islice(thing.items() if type(thing) is dict else thing, self._limit))
        context[id(thing)] = 1
        text, readable, recursive = super().format(shorter, context, maxlevels, level)
        del context[id(thing)]
        end = "})" if type(thing) is frozenset else text[-1]
        return f"{text[:-len(end)].rstrip(',')}, {rest!r}{end}", readable, recursive

    def _format_items(self, items, *place):
        if len(items) > self._limit:
            items = [*islice(items, self._limit), _Rest(len(items) - self._limit)]
        super()._format_items(items, *place)

    def _format_dict_items(self, items, stream, indent, *place):
        super()._format_dict_items(list(islice(items, self._limit)), stream, indent, *place)
        if len(items) > self._limit:
            stream.write(",\n" + " " * (indent + 1) + repr(_Rest(len(items) - self._limit)))


def text_of(value, limit, in_lines):
    """What repr() or, in lines, pprint gives, with at most limit elements of each container."""
    if in_lines:
        return _Printer(limit).pformat(value)
    if any(type(value) is kind for kind in _KINDS):
        return _Printer(limit, width=sys.maxsize, sort_dicts=False).pformat(value)
    return repr(value)
