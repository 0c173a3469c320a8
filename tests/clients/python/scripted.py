"""What tests need to be an engine: its bytes, and a thread that speaks them."""

import socket
import struct
import threading

import krutil
from eventually import PATIENCE
from krutil import schema, wire

MAGIC = b"\x89KRUTIL\n"


def body(message):
    data = message.SerializeToString()
    return struct.pack("<I", len(data)) + data


def hello(**changes):
    """An engine's first message."""
    message = schema.SessionHello(role=1, protocol="krutil", versionMajor=1, build="scripted")
    message.features.add(name="ZEROCOPY", value="enable", handling=3)
    message.limits.tag, message.limits.taggedFrame, message.limits.arrayMessage = 128, 4 << 20, 64 << 20
    message.limits.message, message.limits.frames = 4 << 30, 65536
    for name, value in changes.items():
        setattr(message, name, value)
    return message


def first(message=None, layout=1):
    return MAGIC + struct.pack("<I", layout) + body(message or hello())


def verdict(accepted=True, refusal="", features=(("ZEROCOPY", "enable"),)):
    message = schema.SessionVerdict(accepted=accepted, refusal=refusal)
    for name, value in features:
        message.features.add(name=name, value=value)
    return body(message)


GREETING = first() + verdict()


def frame(tag, content=b"", stream=0, index=1, last=True, kind=None, frame_type=29, size=None):
    """One frame, of which anything can be wrong."""
    kind = (2 if tag is None else 1) if kind is None else kind
    tag = (tag or "").encode()
    return wire.HEADER.pack(kind | (0x80 if last else 0), frame_type, len(tag), stream, index,
                            len(content) if size is None else size) + tag + content


def message(stream, *frames):
    """A message of frames without their places: (tag, object of Protocol Buffers or bytes[, frame type])."""
    data = b""
    for index, (tag, content, *frame_type) in enumerate(frames, 1):
        content = content if isinstance(content, bytes) else content.SerializeToString()
        data += frame(tag, content, stream, index, index == len(frames), frame_type=(frame_type or [29])[0])
    return data


def result(**fields):
    made = schema.IIPResult(**fields)
    made.id.lo = 1
    return made


def reply(result_index=1):
    made = schema.IIPReply(resultID=result_index)
    made.id.lo = 1
    return made


SHUTDOWN = message(0, ("krutil:QVMShutdownEvent", b""))
DONE = (("krutil:IIPResult", result()), ("krutil:IIPReply", reply()))


class ScriptedEngine:
    """Runs `script(engine)` in a thread, with one end of a socket pair; `self.connection` is the other end.

    The stream ends with the script. What the client has sent by then is in `received`.
    """

    def __init__(self, script):
        self.connection, self._socket = socket.socketpair()
        self._reader = wire.Reader(self._socket)
        self._script = script
        self._error = None
        self._thread = threading.Thread(target=self._run)
        self._thread.start()

    def send(self, data):
        self._socket.sendall(data)

    def greet(self):
        """Sends and reads what comes before the first frame."""
        self.send(GREETING)
        return self.read_greeting()

    def read_greeting(self):
        """The client's first message and its verdict."""
        assert self._reader.read(8, "magic") == MAGIC
        assert self._reader.read(4, "layout") == struct.pack("<I", 1)
        theirs = schema.SessionHello.FromString(bytes(self.read_body()))
        return theirs, schema.SessionVerdict.FromString(bytes(self.read_body()))

    def read_body(self):
        return self._reader.read(struct.unpack("<I", self._reader.read(4, "length"))[0], "body")

    def read_message(self):
        """The client's next message: `krutil.wire.Message`."""
        return wire.read_message(self._reader, krutil.Limits())

    def read_abort(self):
        """Reads up to the client's abort, and returns its text. The client may return before what it was lent."""
        try:
            while wire.read_message(self._reader, krutil.Limits(), on_return=lambda number: None) is not None:
                pass
        except wire.PeerAborted as abort:
            return str(abort)
        except wire.EndOfStream as end:
            return f"no abort: {end}"
        return "no abort"

    def read_goodbye(self):
        header = wire.HEADER.unpack(self._reader.read(wire.HEADER.size, "goodbye"))
        assert header == (3, 0, 0, 0, 0, 0), header

    def half_close(self):
        """Sends nothing more, and goes on reading."""
        self._socket.shutdown(socket.SHUT_WR)

    def join(self):
        """Waits for the end of the script; what has gone wrong in it is raised here."""
        self._thread.join(PATIENCE)
        if self._error:
            raise self._error

    def _run(self):
        try:
            with self._socket:
                self._script(self)
        except BaseException as error:
            self._error = error
