"""The bytes of a session after its handshake: frames and messages. No threads, and nothing about what messages mean.

docs/session-wire.md describes every byte. Texts of violations are the ones that are listed there.
"""

import array
import os
import socket
import struct
import time
from collections import deque
from dataclasses import dataclass
from typing import TYPE_CHECKING, Any, Callable, Optional, Sequence, Union

from .memory import memory_for
from .parts import first_beyond
from .schema import Array, EvalIIP, FEvalIIP, IIPCancelMessage, IIPEnqueueMessage

if TYPE_CHECKING:
    from .shared import Borrower, Lender, Place

LONGEST_REASON = 4_096

TAGGED, DATA, GOODBYE, ABORT, SHARED_DATA, RETURN = 1, 2, 3, 4, 5, 6
LAST = 0x80
HEADER = struct.Struct("<BBHIQQ")

ARRAY_TAG = "krutil:QDA"

# What this end sends, by tag.
_SENT = {"krutil:IIPEnqueueMessage": IIPEnqueueMessage, "krutil:IIPCancelMessage": IIPCancelMessage,
         "krutil:EvalIIP": EvalIIP, "krutil:FEvalIIP": FEvalIIP, ARRAY_TAG: Array}

# Numbers: the socket module's own take as long to combine with another as a system call.
_CUT, _CLOSE_ON_EXEC, _WAIT_FOR_ALL = int(socket.MSG_CTRUNC), int(socket.MSG_CMSG_CLOEXEC), int(socket.MSG_WAITALL)

Buffer = Union[bytes, bytearray, memoryview]


class Violation(Exception):
    """The engine broke the protocol. The text goes into the abort."""


class EndOfStream(Exception):
    """The stream has ended in the middle of something."""

    def __init__(self, what: str, done: int, size: int) -> None:
        super().__init__(f"the stream ended after {done} of the {size} bytes of {what}")
        self.done = done


class PeerAborted(Exception):
    """The engine ended the session; the text is its reason."""


@dataclass(frozen=True)
class Limits:
    """What an end accepts, in bytes; `frames` is a number of frames, `parts` one of fields in a tagged frame."""

    tag: int = 128
    tagged_frame: int = 4 << 20
    array_message: int = 64 << 20
    message: int = 4 << 30
    frames: int = 65_536
    parts: int = 262_144

    def of_content(self, tag: str) -> tuple[str, int]:
        """Name and number of the limit for the content of a tagged frame."""
        return ("arrayMessage", self.array_message) if tag == ARRAY_TAG else ("taggedFrame", self.tagged_frame)


@dataclass(slots=True)
class Frame:
    """One frame. `tag` is None for a data frame."""

    tag: Optional[str]
    type: int
    content: Buffer
    #: Where the content lies, if the peer may map it there.
    place: "Optional[Place]" = None


class Message:
    """A message that was read: frames that refer to each other by index, the last of which is the root."""

    def __init__(self, stream: int, frames: list[Frame], most_parts: int) -> None:
        self.stream = stream
        self._most_parts = most_parts
        self.root = frames[-1].tag or ""
        self._frames: list[Optional[Frame]] = list(frames)

    def take_root(self, kind: Any, frame_type: int = 29) -> Any:
        """The object of the root. Each frame can be taken once."""
        return self._parsed(len(self._frames), self._take(len(self._frames)), self.root, kind, frame_type)

    def take(self, index: int, kinds: dict[str, Any], frame_type: int = 29) -> tuple[str, Any]:
        """Tag and object of the tagged frame at the index, which comes from the peer. `kinds` are the messages that it
        may be, by tag."""
        frame = self._take(index)
        if frame.tag is None:
            raise self.unreadable(f"frame {index}: expected a tagged frame, got a data frame of type {frame.type}")
        if frame.tag not in kinds:
            raise self.unreadable(f'frame {index}: expected an object that "{self.root}" can refer to, '
                                   f'got one with tag "{frame.tag}"')
        return frame.tag, self._parsed(index, frame, frame.tag, kinds[frame.tag], frame_type)

    def take_data(self, index: int) -> Buffer:
        """The bytes of the data frame at the index, where they were received."""
        frame = self._take(index)
        if frame.tag is not None:
            raise self.unreadable(f'frame {index}: expected a data frame, got a tagged frame with tag "{frame.tag}"')
        return frame.content

    def _take(self, index: int) -> Frame:
        if not 0 < index <= len(self._frames):
            raise self.unreadable(f"frame {index}: expected a frame, got none: the message has {len(self._frames)}")
        frame = self._frames[index - 1]
        if frame is None:
            raise self.unreadable(f"frame {index}: expected a frame, got none: it was read already")
        self._frames[index - 1] = None
        return frame

    def _parsed(self, index: int, frame: Frame, tag: str, kind: Any, frame_type: int) -> Any:
        """The content as a message of Protocol Buffers. Bytes that are cut are refused: no engine sends them."""
        if frame.type != frame_type:
            raise self.unreadable(f'frame {index}: expected the frame type of "{tag}", got {frame.type}')
        # A part takes two bytes or more, so nearly no content has to be counted.
        if len(frame.content) // 2 > self._most_parts:
            beyond = first_beyond(kind.DESCRIPTOR, memoryview(frame.content), self._most_parts)
            if beyond is not None:
                raise Violation(f'frame "{tag}", byte {beyond}: expected at most {self._most_parts} fields (limit "parts"), '
                                'got more')
        made = kind()
        try:
            made.MergeFromString(frame.content)
        except Exception as error:  # DecodeError, and others in some versions
            raise self.unreadable(f'the content of "{tag}" does not parse ({error})') from None
        return made

    def unreadable(self, what: str) -> Violation:
        """What to raise when a part of this message makes no sense."""
        return Violation(f'cannot read "{self.root}": {what}')


class DescriptorQueue:
    """Descriptors that have come beside the bytes, and that no frame has taken yet."""

    MOST = 32
    SPACE = socket.CMSG_SPACE((MOST + 1) * array.array("i").itemsize)

    def __init__(self) -> None:
        self._waiting: "deque[int]" = deque()

    def add(self, ancillary: Sequence[tuple[int, int, bytes]], flags: int) -> None:
        """Takes what came with a read of the stream."""
        for level, kind, data in ancillary:
            if (level, kind) == (socket.SOL_SOCKET, socket.SCM_RIGHTS):
                numbers = array.array("i")
                numbers.frombytes(data[:len(data) - len(data) % numbers.itemsize])
                self._waiting.extend(numbers)
        if flags & _CUT:
            raise Violation(f"expected at most {self.MOST} descriptors at once, and as many as this process may still "
                            "open; some are lost")
        if len(self._waiting) > self.MOST:
            raise Violation(f"expected at most {self.MOST} descriptors ahead of the frames that need them, "
                            f"got {len(self._waiting)}")

    def take(self) -> Optional[int]:
        """The next one, which the caller owns then."""
        return self._waiting.popleft() if self._waiting else None

    def take_all(self) -> list[int]:
        taken = list(self._waiting)
        self._waiting.clear()
        return taken

    def __del__(self) -> None:
        for descriptor in self._waiting:
            os.close(descriptor)


class Reader:
    """Reads from a socket: through a buffer what is small, straight into its place what is large."""

    BUFFERED = 65_536
    _SMALL = 4_096

    def __init__(self, connection: socket.socket) -> None:
        self._socket = connection
        self._buffer = bytearray(self.BUFFERED)
        self._view = memoryview(self._buffer)
        # What is unread lies between these places of the buffer.
        self._begin = self._end = 0
        #: Until when what is asked for must have come, by time.monotonic(). Else `TimeoutError` is raised.
        self.deadline: Optional[float] = None
        #: What comes beside the bytes. None for an end that takes none: the system closes them then.
        self.descriptors: Optional[DescriptorQueue] = None

    def read(self, size: int, what: str, *numbers: int) -> Buffer:
        """The next `size` bytes, in memory of their own that can be written to. `what`, a format for the numbers, names
        them when the stream ends before."""
        begin, end = self._begin, self._begin + size
        if end > self._end:
            if size > self._SMALL:
                return self._read_large(size, what, *numbers)
            done = self._end - begin
            self._view[:done] = self._view[begin:self._end]
            self._begin, self._end = 0, done
            while self._end < size:
                self._end += self._receive(self._view[self._end:], 0, self._end, size, what, *numbers)
            begin, end = 0, size
        self._begin = end
        return self._buffer[begin:end]

    def _read_large(self, size: int, what: str, *numbers: int) -> Buffer:
        try:
            target = memory_for(size)
        except MemoryError:
            raise Violation(f"there is no memory for {what % numbers}, {size} bytes") from None
        done = self._end - self._begin
        target[:done] = self._view[self._begin:self._end]
        self._begin = self._end = 0
        while done < size:
            # The system comes back when all is there, or nothing more will come.
            done += self._receive(target[done:], _WAIT_FOR_ALL, done, size, what, *numbers)
        return target

    def usual_message(self, limits: Limits) -> Optional[Message]:
        """The next message, if nothing about it is special: tagged frames that are small, have arrived whole, and keep
        to all rules. Otherwise None, and nothing is taken; `read_message()` reads any message, and knows what is wrong
        with it. Waits until something has arrived."""
        if self._begin == self._end:
            self._begin = 0
            self._end = self._receive(self._view, 0, 0, HEADER.size, "the header of frame %d", 1)
        buffer, begin, arrived = self._buffer, self._begin, self._end
        frames: list[Frame] = []
        stream, room = 0, limits.message
        while begin + HEADER.size <= arrived:
            kind, frame_type, tag_size, its_stream, index, size = HEADER.unpack_from(buffer, begin)
            begin += HEADER.size
            content = begin + tag_size
            end = content + size
            if not frames:
                stream = its_stream
            room -= tag_size + size
            if kind | LAST != TAGGED | LAST or index != len(frames) + 1 or its_stream != stream or end > arrived \
                    or not 0 < tag_size <= limits.tag or size > limits.tagged_frame or room < 0 \
                    or index > limits.frames:
                return None
            tag = str(buffer[begin:content], "utf-8", "replace")
            if tag == ARRAY_TAG:
                return None  # It has a limit of its own.
            frames.append(Frame(tag, frame_type, buffer[content:end]))
            begin = end
            if kind & LAST:
                self._begin = begin
                return Message(stream, frames, limits.parts)
        return None

    def buffered(self) -> bytes:
        """What has come behind all that was read."""
        return bytes(self._view[self._begin:self._end])

    def _receive(self, target: memoryview, flags: int, done: int, size: int, what: str, *numbers: int) -> int:
        if self.deadline is not None:
            self._socket.settimeout(max(self.deadline - time.monotonic(), 1e-3))
        try:
            if self.descriptors is None:
                count = self._socket.recv_into(target, 0, flags)
            else:
                count, ancillary, told, _ = self._socket.recvmsg_into([target], DescriptorQueue.SPACE,
                                                                      flags | _CLOSE_ON_EXEC)
                if ancillary or told & _CUT:
                    self.descriptors.add(ancillary, told)
        except ConnectionResetError:
            count = 0  # The engine has closed the stream without reading all that was sent to it.
        if count == 0:
            raise EndOfStream(what % numbers, done, size)
        return count


def read_message(reader: Reader, limits: Limits, borrower: "Optional[Borrower]" = None,
                 on_return: Optional[Callable[[int], object]] = None) -> Optional[Message]:
    """The next message, or None where the stream ends between two messages. In a session with shared memory, `borrower`
    maps contents, and `on_return` is called with the number of each content that the peer returns meanwhile."""
    frames: list[Frame] = []
    stream = total = 0
    while True:
        number = len(frames) + 1
        try:
            message = None if frames else reader.usual_message(limits)
            if message is not None:
                return message
            header = reader.read(HEADER.size, "the header of frame %d", number)
        except EndOfStream as end:
            if end.done == 0 and not frames:
                return None
            raise
        kind, frame_type, tag_size, its_stream, index, size = HEADER.unpack(header)
        last, kind = kind & LAST, kind & ~LAST
        if kind != TAGGED and kind != DATA:
            if kind == RETURN and on_return:
                _check_return(frame_type, (last, tag_size, its_stream, size), number)
                on_return(index)
                continue
            if kind != SHARED_DATA or not borrower:
                _read_end(reader, kind, (last, frame_type, tag_size, its_stream, index), size, number,
                          borrower is not None)
        if index != number:
            raise Violation(f"frame index: expected {number}, got {index}")
        if frames and its_stream != stream:
            raise Violation(f"stream ID of frame {number}: expected {stream} as in the frames before it in its "
                            f"message, got {its_stream}")
        stream = its_stream
        _check_sizes(kind, number, stream, tag_size, size, total, limits)
        total += tag_size + size
        tag = None
        if kind == TAGGED:
            tag = str(reader.read(tag_size, "the tag of frame %d", number), "utf-8", "replace")
            name, limit = limits.of_content(tag)
            if size > limit:
                raise _too_large(f'content of frame {number} with tag "{tag}"', name, limit, f"{size}")
        content = reader.read(size, "the content of frame %d", number)
        if kind == SHARED_DATA and borrower:
            content = borrower.borrow(content, f"frame {number} on stream {stream}")
            total += len(content) - size
            if total > limits.message:
                raise _too_large(f"message with frame {number} on stream {stream}", "message", limits.message,
                                 f"{total - len(content)} bytes and a content of {len(content)}")
        frames.append(Frame(tag, frame_type, content))
        if last:
            if tag is None:
                raise Violation(f"message on stream {stream}: expected a tagged frame as its last one, "
                                "got a data frame")
            return Message(stream, frames, limits.parts)


def _check_sizes(kind: int, number: int, stream: int, tag_size: int, size: int, total: int, limits: Limits) -> None:
    """What a header claims, before memory is asked for."""
    if kind != TAGGED and tag_size:
        raise Violation(f"tag of a data frame (frame {number} on stream {stream}): expected none, got {tag_size} bytes")
    if kind == TAGGED and not tag_size:
        raise Violation(f"tag of a tagged frame (frame {number} on stream {stream}): expected at least 1 byte, "
                        "got none")
    if tag_size > limits.tag:
        raise _too_large(f"tag of frame {number} on stream {stream}", "tag", limits.tag, f"{tag_size}")
    if number > limits.frames:
        raise Violation(f'number of frames of a message exceeds the limit "frames": expected at most {limits.frames} '
                        f"frames, got {number}")
    if kind == SHARED_DATA and size != 24:
        raise Violation(f"content of a shared data frame (frame {number} on stream {stream}): expected 24 bytes, "
                        f"got {size}")
    if total + tag_size + size > limits.message:
        raise _too_large(f"message with frame {number} on stream {stream}", "message", limits.message,
                         f"{total + tag_size} bytes and a content of {size}")


def _check_return(frame_type: int, others: tuple[int, ...], number: int) -> None:
    if frame_type > 1 or any(others):
        raise Violation("return frame: expected frame type 0 or 1, and last bit, tag size, stream ID and content size "
                        "0")
    if number > 1:
        raise Violation(f"return frame in the middle of a message: expected frame {number}")


def _read_end(reader: Reader, kind: int, others: tuple[int, ...], size: int, number: int, shares: bool) -> None:
    """What is no part of a message: always the end of the session."""
    if kind == GOODBYE:
        if any(others):
            raise Violation("goodbye frame: expected last bit, frame type, tag size, stream ID and index 0")
        if size:
            raise Violation(f"goodbye frame: expected no content, got {size} bytes")
        if number > 1:
            raise Violation(f"goodbye frame in the middle of a message: expected frame {number}")
        raise Violation("goodbye frame: expected one from clients only, got one from the engine")
    if kind == ABORT:
        if any(others):
            raise Violation("abort frame: expected last bit, frame type, tag size, stream ID and index 0")
        if size > LONGEST_REASON:
            raise Violation(f"abort frame: expected a reason of at most {LONGEST_REASON} bytes, got {size}")
        raise PeerAborted(str(reader.read(size, "the reason of an abort"), "utf-8", "replace"))
    kinds = "3 (goodbye), 4 (abort), 5 (shared data) or 6 (return)" if shares else "3 (goodbye) or 4 (abort)"
    raise Violation(f"frame kind: expected 1 (tagged), 2 (data), {kinds}, got {kind}")


def _too_large(what: str, name: str, limit: int, got: str) -> Violation:
    return Violation(f'{what} exceeds the limit "{name}": expected at most {limit} bytes, got {got}')


@dataclass
class HeaderWithDescriptor:
    """Bytes to be sent with the descriptor beside them."""

    data: bytes
    descriptor: int


Piece = Union[Buffer, HeaderWithDescriptor]


def message_bytes(stream: int, frames: Sequence[Frame], peer: Limits,
                  lender: "Optional[Lender]" = None) -> tuple[list[Piece], int]:
    """The pieces of a message, to be sent in this order, and how many bytes they have. What the peer does not accept is
    a `ValueError`. Contents that have a place are lent, if there is a lender."""
    if len(frames) > peer.frames:
        raise ValueError(f'the request has {len(frames)} frames; the engine accepts {peer.frames} (its limit "frames")')
    buffers: list[Piece] = []
    lent: list[tuple[int, Frame]] = []
    total = 0
    for index, frame in enumerate(frames, 1):
        tag, size = b"", len(frame.content)
        if frame.tag is not None:
            tag = frame.tag.encode()
            name, limit = peer.of_content(frame.tag)
            if size > limit:
                raise ValueError(f'a part of the request ("{frame.tag}") has {size} bytes; the engine accepts {limit} '
                                 f'(its limit "{name}")')
            if len(tag) > peer.tag:
                raise ValueError(f'the tag "{frame.tag}" is longer than the engine accepts ({peer.tag} bytes, its '
                                 'limit "tag")')
            # As in Message._parsed().
            if size // 2 > peer.parts and \
                    first_beyond(_SENT[frame.tag].DESCRIPTOR, memoryview(frame.content), peer.parts) is not None:
                raise ValueError(f'a part of the request ("{frame.tag}") has more than {peer.parts} fields, which is what '
                                 'the engine accepts (its limit "parts")')
        total += len(tag) + size
        kind = (DATA if frame.tag is None else TAGGED) | (LAST if index == len(frames) else 0)
        if frame.place is not None and lender is not None:
            lent.append((len(buffers), frame))
        buffers.append(HEADER.pack(kind, frame.type, len(tag), stream, index, size) + tag)
        buffers.append(frame.content)
    if total > peer.message:
        raise ValueError(f'the request has {total} bytes; the engine accepts {peer.message} (its limit "message")')
    size = total + len(frames) * HEADER.size
    for at, frame in lent:
        assert frame.place is not None and lender is not None
        content = lender.lend(frame.place)
        size += len(content) - len(frame.content)
        header = HEADER.pack(SHARED_DATA, frame.type, 0, stream, at // 2 + 1, len(content))
        buffers[at:at + 2] = HeaderWithDescriptor(header, frame.place.memory.descriptor), content
    return buffers, size


def return_bytes(number: int, still_mapped: bool) -> bytes:
    return HEADER.pack(RETURN, still_mapped, 0, 0, number, 0)


def goodbye_bytes() -> bytes:
    return HEADER.pack(GOODBYE, 0, 0, 0, 0, 0)


def abort_bytes(reason: str) -> bytes:
    content = reason.encode()[:LONGEST_REASON]
    return HEADER.pack(ABORT, 0, 0, 0, 0, len(content)) + content
