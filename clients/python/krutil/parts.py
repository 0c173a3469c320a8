"""How many parts a content of Protocol Buffers has. Two bytes may become an object of some hundred, and a parser makes them
all before it says how many there are.

docs/session-wire.md says what counts. Whether a content is whole is the parser's business: this stops where it is not.
"""

from functools import lru_cache
from typing import Any, Optional

_NUMBER, _FIXED_64, _BYTES, _BEGIN, _END, _FIXED_32 = range(6)
_LONGEST_NUMBER = 10

#: Messages inside a message, by the number of their field.
_Fields = dict[int, Any]
_UNKNOWN: _Fields = {}


def first_beyond(descriptor: Any, content: memoryview, most: int) -> Optional[int]:
    """The byte at which the first field begins that is more than so many; None when there are no more."""
    fields = _messages_of(descriptor)
    outer: list[tuple[int, _Fields]] = []
    at, end, count = 0, len(content), 0
    try:
        while at < end or outer:
            if at >= end:
                end, fields = outer.pop()
                continue
            begin = at
            tag, at = _number(content, at)
            wire_type = tag & 7
            if wire_type == _END:
                end, fields = outer.pop()
                continue
            count += 1
            if count > most:
                return begin
            if wire_type == _NUMBER:
                at = _number(content, at)[1]
            elif wire_type == _BYTES:
                size, at = _number(content, at)
                inside = fields.get(tag >> 3)
                if inside is None or at + size > end:
                    at += size
                else:
                    outer.append((end, fields))
                    end, fields = at + size, _messages_of(inside)
            elif wire_type == _BEGIN:
                # No message of the protocol has a group, so nobody knows what is in it.
                outer.append((end, fields))
                fields = _UNKNOWN
            elif wire_type in (_FIXED_64, _FIXED_32):
                at += 8 if wire_type == _FIXED_64 else 4
            else:
                return None
    except IndexError:
        pass  # It is not whole.
    return None


@lru_cache(maxsize=None)
def _messages_of(descriptor: Any) -> _Fields:
    return {field.number: field.message_type for field in descriptor.fields if field.message_type is not None}


def _number(content: memoryview, at: int) -> tuple[int, int]:
    """A number, and where it ends."""
    value = 0
    for place in range(_LONGEST_NUMBER):
        byte = content[at + place]
        value |= (byte & 0x7F) << 7 * place
        if byte < 0x80:
            return value, at + place + 1
    raise IndexError(at)
