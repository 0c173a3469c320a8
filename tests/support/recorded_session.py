"""Recordings of sessions, made of messages that a test gives."""

import struct

from recordings import INBOUND, OUTBOUND, Recording

MAGIC = b"\x89KRUTIL\n"


def varint(value):
    out = b""
    while value > 0x7F:
        out += bytes([value & 0x7F | 0x80])
        value >>= 7
    return out + bytes([value])


def field(number, content):
    """A field of Protocol Buffers: a number, or bytes."""
    if isinstance(content, int):
        return varint(number << 3) + varint(content)
    return varint(number << 3 | 2) + varint(len(content)) + content


LIMITS = b"".join(field(i + 1, n) for i, n in enumerate((128, 4 << 20, 64 << 20, 4 << 30, 65_536)))


def hello(role, limits=LIMITS, layout=1):
    body = field(1, role) + field(2, b"krutil") + field(3, 1) + field(6, limits) + field(8, b"test\x1b[31m")
    return MAGIC + struct.pack("<II", layout, len(body)) + body


def verdict(accepted=1, shared=False, living=False):
    def feature(name, value):
        return field(2, field(1, name) + field(2, value))
    body = (field(1, accepted) + (feature(b"SHM", b"descriptors") if shared else b"")
            + (feature(b"KEEPALIVE", b"frames") if living else b"") + feature(b"ZEROCOPY", b"enable"))
    return struct.pack("<I", len(body)) + body


def frame(kind, frame_type, stream, index, tag, content, last=True, size=None):
    return struct.pack("<BBHIQQ", kind | (0x80 if last else 0), frame_type, len(tag), stream, index,
                       len(content) if size is None else size) + tag.encode() + content


ID = field(1, field(2, 1))
TRAITS = field(3, b"") + field(4, b"")
IIP = field(1, field(2, b"python") + TRAITS)


def request(stream=1, code=b"print(1)", lo=0xABCDEF):
    return [frame(1, 29, stream, 1, "krutil:EvalIIP", IIP + field(2, code), last=False),
            frame(1, 27, stream, 2, "krutil:IIPEnqueueMessage", field(1, 1) + field(2, field(2, lo)) + field(5, 6))]


def reply(stream=1, error=b""):
    """With an error, which is a RuntimeException, or without."""
    return [frame(1, 29, stream, 1, "krutil:IIPResult", ID + field(2, error), last=False),
            frame(1, 29, stream, 2, "krutil:IIPReply", ID + field(2, 1))]


def text(stream, content):
    return frame(1, 29, stream, 1, "krutil:TextBaseEvent", field(3, content))


GOODBYE = frame(3, 0, 0, 0, "", b"", last=False)
SHUTDOWN = frame(1, 29, 0, 1, "krutil:QVMShutdownEvent", b"")


def handshake(recording, shared=False, living=False):
    recording.add(OUTBOUND, hello(0))
    recording.add(INBOUND, hello(1))
    recording.add(OUTBOUND, verdict(shared=shared, living=living))
    recording.add(INBOUND, verdict(shared=shared, living=living))
    if shared:
        for unit in b"12345678", b"\1":
            recording.add(OUTBOUND, unit)
            recording.add(INBOUND, unit)


def recorded(*units, process="client 4711", **features):
    """A recording: the handshake, then units with their direction in front: > to the engine, < from it."""
    recording = Recording(process)
    handshake(recording, **features)
    for direction, unit in units:
        for each in unit if isinstance(unit, list) else [unit]:
            recording.add(OUTBOUND if direction == ">" else INBOUND, each)
    return recording
