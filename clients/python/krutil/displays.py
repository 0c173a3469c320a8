"""Pictures, and other forms of values, which an engine keeps until its client takes them."""

import json
import re
from dataclasses import dataclass
from typing import Any, Callable, Iterator, Mapping, Union

#: What `on_display` is.
OnDisplay = Callable[["Display"], object]

# The line that stands for a display in the output, as the engine shows it.
_LINE = re.compile(r"\[picture ([0-9]{1,18}): ([a-z0-9+/, ]+)\]\n")
_PNG = "image/png"


@dataclass(frozen=True)
class Display:
    """What code has shown beside text: a figure of matplotlib, or the forms of a value that has some.

    >>> shown = []
    >>> with krutil.start(on_display=shown.append) as session:
    ...     result = session.eval("class Red:\\n  def _repr_html_(self): return '<b>red</b>'\\nRed()")
    >>> result.displays[0].formats, shown == list(result.displays)
    ({'text/html': '<b>red</b>'}, True)
    """

    #: Which one of its session it is, from 1.
    number: int
    #: By type: "image/png" as bytes, "image/svg+xml" and "text/html" as texts. Whoever shows HTML runs what it says.
    formats: Mapping[str, Union[bytes, str]]


class DisplayLine(str):
    """An event: the line that stands for a `Display`, in its place in the output. The display comes at the end."""

    #: The number of the display.
    number: int
    #: Its types.
    types: tuple[str, ...]

    @classmethod
    def of(cls, text: str) -> "DisplayLine | None":
        """The line that a text is, if it is one. A value may look like one as well, so nothing but a question to the
        engine may come of it."""
        match = _LINE.fullmatch(text)
        if match is None:
            return None
        line = cls(text)
        line.number = int(match[1])
        line.types = tuple(each for each in match[2].split(", ") if "/" in each)
        return line


def displays_from(values: Any) -> Iterator[Display]:
    """The displays that the engine has kept, from what it returns. What is none raises a `ValueError`."""
    described, data = values
    pictures = b"" if isinstance(data, str) else data.tobytes()
    position = 0
    try:
        for each in json.loads(described):
            formats: dict[str, Union[bytes, str]] = {}
            for form in each["formats"]:
                kind = str(form["type"])
                if kind == _PNG:
                    size = int(form["bytes"])
                    if not 0 <= size <= len(pictures) - position:
                        raise ValueError(f"a picture of {size} bytes, where {len(pictures) - position} are left")
                    formats[kind] = pictures[position:position + size]
                    position += size
                else:
                    formats[kind] = str(form["text"])
            yield Display(int(each["number"]), formats)
    except (KeyError, TypeError) as error:
        raise ValueError(f"a description without what it must have ({error!r})") from None
