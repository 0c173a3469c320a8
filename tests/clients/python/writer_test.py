"""How bytes leave a session: whole messages, in order, and never at the cost of whoever sends them."""

import os
import socket
import struct
import threading
import unittest

from krutil.wire import HeaderWithDescriptor
from krutil.writer import Writer
from scripted import PATIENCE

LARGE = 4 << 20


class WriterTest(unittest.TestCase):
    def setUp(self):
        self.failed = threading.Event()
        ours, self.peer = socket.socketpair()
        self.addCleanup(self.peer.close)
        self.peer.settimeout(PATIENCE)
        self.writer = self.writer_to(ours)

    def writer_to(self, connection):
        writer = Writer(connection, self.failed.set)

        def end():
            # A write that waits for its peer ends with the stream.
            connection.shutdown(socket.SHUT_RDWR)
            writer.finish([], PATIENCE)
            connection.close()

        self.addCleanup(end)
        return writer

    def received(self, size):
        data = bytearray()
        while len(data) < size:
            piece = self.peer.recv(size - len(data))
            self.assertTrue(piece, f"the stream ended after {len(data)} of {size} bytes")
            data += piece
        return bytes(data)

    def test_a_small_message_is_written_before_send_returns(self):
        for number in range(100):
            self.writer.send([b"head", b"%04d" % number], 8)
            self.assertEqual(self.peer.recv(100, socket.MSG_DONTWAIT), b"head%04d" % number)

    def with_descriptors(self, count):
        """Pieces of a message with so many descriptors, and its bytes."""
        places = [os.open("/dev/null", os.O_RDONLY) for _ in range(count)]
        for place in places:
            self.addCleanup(os.close, place)
        pieces = [piece for number, place in enumerate(places)
                  for piece in (HeaderWithDescriptor(b"head%04d" % number, place), b"content")]
        return pieces, b"".join(b"head%04dcontent" % number for number in range(count))

    def test_a_small_message_with_descriptors_is_written_before_send_returns(self):
        pieces, sent = self.with_descriptors(16)
        for _ in range(20):
            self.writer.send(pieces, len(sent))
            data, descriptors, _, _ = socket.recv_fds(self.peer, 1000, 17, socket.MSG_DONTWAIT)
            for each in descriptors:
                os.close(each)
            self.assertEqual((data, len(descriptors)), (sent, 16))

    def test_more_than_sixteen_descriptors_never_are_ahead_of_their_frames(self):
        pieces, sent = self.with_descriptors(17)
        self.writer.send(pieces, len(sent))
        received = 0
        while received < len(sent):
            # What comes with a descriptor ends before the next one.
            data, descriptors, _, _ = socket.recv_fds(self.peer, 1000, 17)
            for each in descriptors:
                os.close(each)
            self.assertEqual((data, len(descriptors)), (b"head%04dcontent" % (received // 15), 1))
            received += len(data)

    def test_a_small_message_stays_behind_a_large_one(self):
        large = bytes(LARGE)
        for _ in range(3):
            self.writer.send([large], LARGE)
            self.writer.send([b"small"], 5)
            self.assertEqual(self.received(LARGE + 5), large + b"small")

    def test_small_messages_that_nobody_reads_hold_up_nobody_and_stay_in_order(self):
        count = 3000
        for number in range(count):
            self.writer.send([struct.pack("<I", number), bytes(1000)], 1004)
        data = self.received(1004 * count)
        self.assertEqual([number for number, in struct.iter_unpack("<I1000x", data)], list(range(count)))

    def test_returns_lie_between_messages(self):
        messages = [bytes([number]) * (100_000 if number % 5 == 0 else 100) for number in range(1, 200)]

        def give_back():
            while not stop.wait(1e-4):
                self.writer.send_return(self.sized(b""))
            self.writer.send_return(self.sized(b"end"))

        stop = threading.Event()
        threads = [threading.Thread(target=give_back),
                   threading.Thread(target=lambda: [self.writer.send([self.sized(each)], 4 + len(each))
                                                    for each in messages])]
        for thread in threads:
            thread.start()
        received = []
        while not received or received[-1] != b"end":
            size, = struct.unpack("<I", self.received(4))
            received.append(self.received(size))
            if received[-1] == messages[-1]:
                stop.set()
        for thread in threads:
            thread.join()
        self.assertEqual([each for each in received[:-1] if each], messages)

    @staticmethod
    def sized(content):
        return struct.pack("<I", len(content)) + content

    def test_a_message_stays_behind_the_return_before_it(self):
        for _ in range(200):
            self.writer.send_return(b"return")
            self.writer.send([b"message"], 7)
            self.assertEqual(self.received(13), b"returnmessage")

    def test_a_stream_that_has_ended_is_told(self):
        self.peer.close()
        self.writer.send([b"small"], 5)
        self.assertTrue(self.failed.wait(PATIENCE))

    def test_a_stream_of_another_kind_is_written_by_the_thread(self):
        with socket.create_server(("127.0.0.1", 0)) as server:
            connection = socket.create_connection(server.getsockname())
            self.peer.close()
            self.peer, _ = server.accept()
        self.addCleanup(self.peer.close)
        self.peer.settimeout(PATIENCE)
        writer = self.writer_to(connection)
        writers = []
        writer._write = lambda pieces: (writers.append(threading.current_thread().name), Writer._write(writer, pieces))
        writer.send([b"small"], 5)
        self.assertEqual(self.received(5), b"small")
        self.assertEqual(writers, ["krutil-writer"])


if __name__ == "__main__":
    unittest.main()
