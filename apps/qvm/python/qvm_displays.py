"""Pictures and other forms of values, which are kept for the client until it takes them.

A client sees the line of each display in its place in the output, and asks for all displays when the request is done.
So this module is imported where the first value has such a form, or matplotlib draws.
"""

import json as _json
import sys as _sys

import _qvm
from qvm_warnings import warn as _warn, warning as _issue_warning

# What is kept for a client that does not take it.
_MAX_COUNT = 100
_MAX_BYTES = 32 << 20

_PNG_BEGIN = b"\x89PNG\r\n\x1a\n\x00\x00\x00\rIHDR"

# By number: the formats of each display, as pairs of type and content.
_kept = {}
_kept_bytes = 0
_last_number = 0
_dropped = False


def warn_about(text):
    """Whatever the filters are: each failure is told."""
    _issue_warning("RuntimeWarning", text)


def _png(content):
    if not isinstance(content, bytes):
        raise TypeError(f"expected bytes, got {type(content).__name__}")
    if not content.startswith(_PNG_BEGIN) or len(content) < len(_PNG_BEGIN) + 8:
        raise ValueError("the bytes are not those of a PNG picture")
    return content


def _text(content):
    if not isinstance(content, str):
        raise TypeError(f"expected str, got {type(content).__name__}")
    # A text that holds half of a surrogate pair cannot be sent.
    return content.encode("utf-8", "replace")


# The method of a value's type, the type of what it returns, and how that is checked.
_FORMATS = (("_repr_png_", "image/png", _png),
            ("_repr_svg_", "image/svg+xml", _text),
            ("_repr_html_", "text/html", _text))


def can_show():
    """Whether the running code can show something to the client."""
    return _qvm.can_show()


def offer(value):
    """Keeps the forms of a value for the client, and returns whether it has any. A form that fails is a warning."""
    if not can_show():
        return False
    kind = type(value)
    formats = []
    for name, content_type, check in _FORMATS:
        try:
            method = getattr(kind, name, None)
            content = None if method is None else method(value)
            # Some give a description along with the content.
            if isinstance(content, tuple) and len(content) == 2:
                content = content[0]
            if content is not None:
                formats.append((content_type, check(content)))
        except Exception as error:
            warn_about(f"{kind.__qualname__}.{name}() has failed, so this form is not shown: "
                        f"{type(error).__qualname__}: {error}")
    return bool(formats) and keep(formats)


def keep(formats):
    """Keeps a display, and shows its line. `formats` holds pairs of type and bytes. Returns False when it is too large."""
    global _kept_bytes, _last_number, _dropped
    size = sum(len(content) for _, content in formats)
    if size > _MAX_BYTES:
        warn_about(f"A picture of {size} bytes is not shown: at most {_MAX_BYTES} are kept for the client")
        return False
    _last_number += 1
    _kept[_last_number] = formats
    _kept_bytes += size
    while len(_kept) > _MAX_COUNT or _kept_bytes > _MAX_BYTES:
        oldest = _kept.pop(next(iter(_kept)))
        _kept_bytes -= sum(len(content) for _, content in oldest)
        if not _dropped:
            _dropped = True
            warn_about(f"The oldest pictures are dropped: at most {_MAX_COUNT} of {_MAX_BYTES} bytes together are "
                        f"kept until the client takes them, which it does when the request has ended")
    line = f"[picture {_last_number}: {', '.join(content_type for content_type, _ in formats)}"
    if formats[0][0] == "image/png":
        width, height = _png_size(formats[0][1])
        line += f", {width} x {height}"
    # An event of its own, which a client recognises without looking into other text.
    _qvm.flush()
    _qvm.show(line + "]\n")
    _qvm.flush()
    return True


def _png_size(content):
    at = len(_PNG_BEGIN)
    return int.from_bytes(content[at:at + 4], "big"), int.from_bytes(content[at + 4:at + 8], "big")


def take():
    """All that is kept, which is forgotten: a description in JSON, and the bytes of all pictures, one after another;
    the empty text where there are none, since arrays need NumPy."""
    global _kept, _kept_bytes, _dropped
    displays, _kept, _kept_bytes, _dropped = _kept, {}, 0, False
    described, pictures = [], []
    for number, formats in displays.items():
        entries = []
        for content_type, content in formats:
            if content_type == "image/png":
                width, height = _png_size(content)
                entries.append({"type": content_type, "bytes": len(content), "width": width, "height": height})
                pictures.append(content)
            else:
                entries.append({"type": content_type, "text": content.decode("utf-8")})
        described.append({"number": number, "formats": entries})
    if not pictures:
        data = ""
    else:
        import numpy
        data = numpy.frombuffer(b"".join(pictures), numpy.uint8)
    return _json.dumps(described, ensure_ascii=False), data


def warn_cannot_show():
    """For a picture that is to be shown where it cannot be: names the place in the user's code."""
    frame, level = _sys._getframe(1), 1
    while frame.f_back is not None and (frame.f_code.co_filename == "<qvm>"
                                        or frame.f_globals.get("__name__", "").startswith("matplotlib.")):
        frame = frame.f_back
        level += 1
    _warn("show() shows nothing here: the client cannot show pictures; write one to a file with savefig()",
          RuntimeWarning, level)
