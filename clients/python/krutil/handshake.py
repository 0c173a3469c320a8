"""The first messages of a session: who speaks what, and what both ends settle on."""

import os
import socket
import struct
import subprocess
import sys
import time
from typing import Any, NamedTuple, Optional

from .errors import Aborted, Lost, Refused
from .schema import SessionHello, SessionVerdict
from .shared import Probe
from .wire import DescriptorQueue, EndOfStream, Limits, Reader, Violation

MAGIC = b"\x89KRUTIL\n"
LAYOUT = 1
LONGEST_BODY = 65_536
BUILD = "krutil for Python 0.1.0"

# Capabilities by their numbers in a first message.
INTERACTIVE_COMMAND_LINE = 0
WEB_WINDOW = 4
DEBUGGING = 6

_ENGINE = 1
_IGNORE, _OPTIONAL, _REQUIRED = 0, 1, 3
_NUMBER = struct.Struct("<I")


class _Silence(Exception):
    """The stream has ended with nothing on it."""


class Settled(NamedTuple):
    """What a handshake has come to."""

    #: Large arrays travel in frames of their own.
    zero_copy: bool
    #: What the engine accepts.
    limits: Limits
    #: Contents may stay in memory that both ends see.
    shares: bool = False


def shake_hands(connection: socket.socket, process: "Optional[subprocess.Popen[bytes]]", reader: Reader, limits: Limits,
                capabilities: list[int], timeout: float) -> Settled:
    """Begins a session on a connected socket, as its client; the engine's process is there if this end has started it.

    Raises `Refused` when the ends do not fit, `Aborted` when the engine breaks the protocol (or is none), and `Lost`
    when its stream ends or it has said nothing within the timeout, in seconds.
    """
    ours = _hello(limits, capabilities)
    reader.deadline = time.monotonic() + timeout
    connection.settimeout(timeout)
    # From the first byte on: what the engine says after its verdict may come with it, and a descriptor beside that.
    reader.descriptors = DescriptorQueue()
    try:
        body = ours.SerializeToString()
        _send(connection, MAGIC + _NUMBER.pack(LAYOUT) + _NUMBER.pack(len(body)) + body)
        layout, theirs = _read_hello(reader)
        features, mismatches = settle(ours, layout, theirs)
        _say_verdict(connection, reader, features, mismatches)
        shares = features.get("SHM") == "descriptors" and _probe(connection, reader, reader.descriptors)
    except Violation as violation:
        raise Aborted(f"the engine broke the protocol: {violation}") from None
    except EndOfStream as end:
        raise Lost(f"the engine has gone{how_it_ended(process)} during the handshake: {end}") from None
    except _Silence:
        raise Lost(f"the engine has gone{how_it_ended(process)} before it said anything") from None
    except TimeoutError:
        raise Lost(f"the engine did not finish the handshake within {timeout:g} seconds") from None
    if not shares:
        reader.descriptors = None
    reader.deadline = None
    connection.settimeout(None)
    peer = theirs.limits
    return Settled(features.get("ZEROCOPY") == "enable",
                   Limits(peer.tag, peer.taggedFrame, peer.arrayMessage, peer.message, peer.frames,
                          peer.parts or sys.maxsize), shares)


def how_it_ended(process: "Optional[subprocess.Popen[bytes]]") -> str:
    """What is known of the end of an engine whose stream has ended, in brackets."""
    if process is None:
        return ""
    try:
        code = process.wait(1)
    except subprocess.TimeoutExpired:
        return ""
    return f" (killed by signal {-code})" if code < 0 else f" (exit code {code})"


def settle(ours: Any, layout: int, theirs: Any) -> tuple[dict[str, str], list[str]]:
    """The settled features, and in words whatever does not fit."""
    mismatches = []
    for what, expected, got in (("layout version", LAYOUT, layout),
                                ("protocol", ours.protocol, theirs.protocol),
                                ("version", f"{ours.versionMajor}.{ours.versionMinor}",
                                 f"{theirs.versionMajor}.{theirs.versionMinor}")):
        if expected != got:
            mismatches.append(f"{what}: the client has {expected}, the engine {got}")
    if theirs.role != _ENGINE:
        mismatches.append("both ends are clients")
    features = {}
    entries = [feature for feature in (*ours.features, *theirs.features) if feature.handling != _IGNORE]
    for name in sorted({feature.name for feature in entries}):
        offered = {feature.value for feature in theirs.features if feature.name == name and feature.handling != _IGNORE}
        common = [feature.value for feature in ours.features
                  if feature.name == name and feature.handling != _IGNORE and feature.value in offered]
        if common:
            features[name] = common[0]
        elif any(feature.name == name and feature.handling == _REQUIRED for feature in entries):
            mismatches.append(f'feature "{name}": there is no value that both ends accept')
    return features, mismatches


def _hello(limits: Limits, capabilities: list[int]) -> Any:
    hello = SessionHello(protocol="krutil", versionMajor=1, versionMinor=0, capabilities=sorted(capabilities),
                         build=BUILD)
    # The variable means the same to all programs of this protocol. Without it this end can do either, as it is asked.
    for value in ["disable"] if os.environ.get("QX_DISABLE_ZEROCOPY") else ["enable", "disable"]:
        hello.features.add(name="ZEROCOPY", value=value, handling=_REQUIRED)
    # Every stream that this package opens is a Unix socket.
    hello.features.add(name="SHM", value="descriptors", handling=_OPTIONAL)
    hello.limits.tag = limits.tag
    hello.limits.taggedFrame = limits.tagged_frame
    hello.limits.arrayMessage = limits.array_message
    hello.limits.message = limits.message
    hello.limits.frames = limits.frames
    hello.limits.parts = limits.parts
    return hello


def _read_hello(reader: Reader) -> tuple[int, Any]:
    for place, expected in enumerate(MAGIC):
        try:
            got = bytes(reader.read(1, "the engine's first message"))
        except EndOfStream:
            if place == 0:
                raise _Silence from None
            raise EndOfStream("the beginning of the engine's first message", place, len(MAGIC)) from None
        if got[0] != expected:
            said = (MAGIC[:place] + got + reader.buffered())[:1000].decode("ascii", "backslashreplace").rstrip()
            raise Violation('the peer does not speak this protocol: expected a first message that begins with '
                            f'"\\x89KRUTIL\\n", got "{said}"')
    layout = _NUMBER.unpack(reader.read(4, "the layout of the engine's first message"))[0]
    hello = _read_body(reader, SessionHello, "hello")
    if not hello.HasField("limits"):
        raise Violation("the peer's hello: expected the limits of the peer, got none")
    return layout, hello


def _read_body(reader: Reader, kind: Any, name: str) -> Any:
    length = _NUMBER.unpack(reader.read(4, f"the length of the engine's {name}"))[0]
    if length > LONGEST_BODY:
        raise Violation(f"length of the peer's {name}: expected at most {LONGEST_BODY} bytes, got {length}")
    content = reader.read(length, f"the engine's {name}")
    body = kind()
    try:
        body.MergeFromString(content)
    except Exception:  # DecodeError, and others in some versions
        raise Violation(f"the peer's {name}: its {length} bytes are not a message of its type") from None
    return body


def _say_verdict(connection: socket.socket, reader: Reader, features: dict[str, str], mismatches: list[str]) -> None:
    ours = SessionVerdict(accepted=not mismatches, refusal="; ".join(mismatches))
    if not mismatches:
        for name, value in features.items():
            ours.features.add(name=name, value=value)
    body = ours.SerializeToString()
    _send(connection, _NUMBER.pack(len(body)) + body)
    if mismatches:
        # The engine says what it makes of this, too; it is given a second to do so.
        reader.deadline = time.monotonic() + 1
        try:
            _read_body(reader, SessionVerdict, "verdict")
        except (EndOfStream, TimeoutError, Violation):
            pass
        raise Refused(f"the engine does not fit: {'; '.join(mismatches)}")
    theirs = _read_body(reader, SessionVerdict, "verdict")
    if not theirs.accepted:
        raise Refused(f"the engine refuses the session: {theirs.refusal}")
    if [(feature.name, feature.value) for feature in theirs.features] != list(features.items()):
        raise Refused("the engine has settled on other features than this end")


def _probe(connection: socket.socket, reader: Reader, descriptors: DescriptorQueue) -> bool:
    """Whether memory arrives in both directions: the stream may lead to a relay, which drops descriptors."""
    ours = Probe()
    try:
        socket.send_fds(connection, [ours.token], ours.descriptors(), socket.MSG_NOSIGNAL)
    except (BrokenPipeError, ConnectionResetError):
        pass
    token = reader.read(8, "the engine's probe of shared memory")
    shown = Probe.shows(descriptors, token)
    _send(connection, bytes([shown]))
    answer = reader.read(1, "the engine's answer to the probe of shared memory")[0]
    if answer > 1:
        raise Violation(f"the peer's answer to the probe of shared memory: expected 0 or 1, got {answer}")
    return shown and answer == 1


def _send(connection: socket.socket, data: bytes) -> None:
    try:
        connection.sendall(data, socket.MSG_NOSIGNAL)
    except (BrokenPipeError, ConnectionResetError):
        pass  # What the engine has said before it went is still to be read.
