"""Sends what a session has to say, in order, without holding up whoever says it."""

import array
import queue
import socket
import threading
from typing import Callable, Optional, Sequence

from .wire import HeaderWithDescriptor, Piece

# As many buffers as one system call takes.
_MOST_BUFFERS = 1024


class Writer:
    """A thread that writes to a socket. An exception such as KeyboardInterrupt cannot hit it in the middle of a
    message, and the thread that reads may use it without ever waiting for the peer."""

    def __init__(self, connection: socket.socket, on_failure: Callable[[], object]) -> None:
        self._socket = connection
        self._on_failure = on_failure
        self._queue: "queue.SimpleQueue[Optional[Sequence[Piece]]]" = queue.SimpleQueue()
        self._thread = threading.Thread(target=self._run, name="krutil-writer", daemon=True)
        self._thread.start()

    def send(self, buffers: Sequence[Piece]) -> None:
        """Takes the buffers, which must stay as they are until they are sent."""
        self._queue.put(buffers)

    def finish(self, last: Sequence[Piece], timeout: float) -> None:
        """Sends these buffers behind the message that is being written, and nothing else. Waits `timeout` seconds
        at most."""
        while not self._queue.empty():
            try:
                self._queue.get_nowait()
            except queue.Empty:
                break
        self._queue.put(last)
        self._queue.put(None)
        self._thread.join(timeout)

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
        beside = [] if descriptor is None else \
            [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", [descriptor]))]
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
