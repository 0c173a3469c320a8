"""Sends what a session has to say, in order, without holding up whoever says it."""

import array
import queue
import socket
import threading
from collections import deque
from typing import Callable, Optional, Sequence

from .wire import HeaderWithDescriptor, Piece

# As many buffers as one system call takes.
_MOST_BUFFERS = 1024

# A Unix socket takes so many bytes whole or not at all, with what is beside them, however small its buffer is.
_WHOLE = 2_048

# So many descriptors may be ahead of the bytes of their frames.
_MOST_DESCRIPTORS = 16

# A number: what the socket module makes of two of its own takes as long as a system call.
_AT_ONCE = int(socket.MSG_NOSIGNAL | socket.MSG_DONTWAIT)


class Writer:
    """Writes to a socket. A small message is written by whoever sends it, when nothing waits before it; a thread writes
    all else. So an exception such as KeyboardInterrupt cannot hit the middle of a message, and nobody who sends waits
    for the peer."""

    def __init__(self, connection: socket.socket, on_failure: Callable[[], object]) -> None:
        self._socket = connection
        self._on_failure = on_failure
        self._queue: "queue.SimpleQueue[Optional[Sequence[Piece]]]" = queue.SimpleQueue()
        self._writes_whole = connection.family == socket.AF_UNIX
        # One entry for each that the thread was given and has not written yet. Any thread may add one at any time.
        self._unwritten: "deque[None]" = deque()
        self._thread = threading.Thread(target=self._run, name="krutil-writer", daemon=True)
        self._thread.start()

    def send(self, buffers: Sequence[Piece], size: int) -> None:
        """Takes the buffers of a message, of so many bytes, which must stay as they are until they are sent. For one
        caller at a time."""
        if size <= _WHOLE and self._writes_whole and not self._unwritten and self._sent_at_once(buffers):
            return
        self._hand_over(buffers)

    def send_return(self, frame: bytes) -> None:
        """Takes a frame that may be sent between any two messages. Any thread may call it at any time: an array may end
        in the middle of `send()`."""
        self._hand_over([frame])

    def finish(self, last: Sequence[Piece], timeout: float) -> None:
        """Sends these buffers behind the message that is being written, and nothing else. Waits `timeout` seconds
        at most."""
        while not self._queue.empty():
            try:
                self._queue.get_nowait()
            except queue.Empty:
                break
        self._hand_over(last)
        self._queue.put(None)
        self._thread.join(timeout)
        # Arrays that the peer has lent keep this object, to be returned. What they keep is never freed if it keeps them in
        # turn, because the garbage collector does not look into arrays. So they must not lead to a program's functions.
        self._on_failure = _do_nothing

    def _sent_at_once(self, pieces: Sequence[Piece]) -> bool:
        descriptors = [piece.descriptor for piece in pieces if isinstance(piece, HeaderWithDescriptor)]
        if len(descriptors) > _MOST_DESCRIPTORS:
            return False
        buffers = [piece.data if isinstance(piece, HeaderWithDescriptor) else piece for piece in pieces]
        try:
            self._socket.sendmsg(buffers, _beside(descriptors), _AT_ONCE)
            return True
        except OSError:
            return False  # The thread waits for room, and knows what to do when the stream has ended.

    def _hand_over(self, buffers: Sequence[Piece]) -> None:
        self._unwritten.append(None)
        self._queue.put(buffers)

    def _run(self) -> None:
        while True:
            buffers = self._queue.get()
            if buffers is None:
                return
            try:
                self._write(buffers)
            except OSError:
                self._on_failure()
                return
            # What was sent is not kept until there is more to send.
            del buffers
            self._unwritten.pop()

    def _write(self, pieces: Sequence[Piece]) -> None:
        waiting: list[memoryview] = []
        descriptor: Optional[int] = None
        for piece in pieces:
            if isinstance(piece, HeaderWithDescriptor):
                # It goes with the first byte of what it is sent with, which is this header's.
                self._write_together(waiting, descriptor)
                waiting, descriptor = [memoryview(piece.data)], piece.descriptor
            elif len(piece):
                waiting.append(memoryview(piece))
        self._write_together(waiting, descriptor)

    def _write_together(self, buffers: list[memoryview], descriptor: Optional[int]) -> None:
        beside = _beside([] if descriptor is None else [descriptor])
        while buffers:
            sent = self._socket.sendmsg(buffers[:_MOST_BUFFERS], beside, socket.MSG_NOSIGNAL)
            beside = []
            done = 0
            while done < len(buffers) and sent >= len(buffers[done]):
                sent -= len(buffers[done])
                done += 1
            del buffers[:done]
            if sent:
                buffers[0] = buffers[0][sent:]


def _do_nothing() -> None:
    pass


def _beside(descriptors: Sequence[int]) -> "list[tuple[int, int, array.array[int]]]":
    """What goes with the first byte so that the peer gets the descriptors."""
    return [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", descriptors))] if descriptors else []
