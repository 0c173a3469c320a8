"""The standard streams of code: what it prints goes to the client, and what it reads comes from there."""

import codecs
import io

import _qvm
from qvm_warnings import held_up


class TextStream(io.TextIOBase):
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
        self.buffer = ByteStream(self)

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


class ByteStream(io.BufferedIOBase):
    """The buffer attribute of a text stream: bytes that are UTF-8 text."""

    mode = "wb"

    def __init__(self, text):
        self.name = text.name
        self._text = text
        self._decoder = codecs.getincrementaldecoder("utf-8")("replace")

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


class InputStream(io.TextIOBase):
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


held_up.append(InputStream.readline.__code__)
