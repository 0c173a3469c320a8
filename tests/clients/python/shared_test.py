"""Shared memory: with the real engine, and with scripts that keep to its rules or break them."""

import fcntl
import gc
import mmap
import os
import socket
import struct
import sys
import threading
import types
import unittest
from unittest import mock

import krutil
import numpy
from krutil import schema, shared, wire
from krutil.writer import Writer
from eventually import PATIENCE, eventually
from scripted import DONE, SHUTDOWN, ScriptedEngine, first, frame, hello, message, reply, verdict

KiB, MiB = 1 << 10, 1 << 20
SIZE = 2 * MiB


class Bytes:
    """Counts what goes through the streams of this process."""

    def __enter__(self):
        self.sent = self.received = 0
        write, write_at_once, receive = Writer._write_together, Writer._sent_at_once, wire.Reader._receive

        def counted_write(writer, buffers, descriptor):
            self.sent += sum(len(buffer) for buffer in buffers)
            return write(writer, buffers, descriptor)

        def counted_write_at_once(writer, pieces):
            done = write_at_once(writer, pieces)
            if done:
                self.sent += sum(len(piece.data if isinstance(piece, wire.HeaderWithDescriptor) else piece)
                                 for piece in pieces)
            return done

        def counted_receive(reader, *arguments):
            count = receive(reader, *arguments)
            self.received += count
            return count

        self._patches = [mock.patch.object(Writer, "_write_together", counted_write),
                         mock.patch.object(Writer, "_sent_at_once", counted_write_at_once),
                         mock.patch.object(wire.Reader, "_receive", counted_receive)]
        for patch in self._patches:
            patch.start()
        return self

    def __exit__(self, *error):
        for patch in self._patches:
            patch.stop()


class EngineTest(unittest.TestCase):
    """With krutil-qvm, whose directory is the first in PATH."""

    def setUp(self):
        os.environ.pop("QX_DISABLE_ZEROCOPY", None)

    def test_an_argument_that_is_born_in_shared_memory_is_not_sent(self):
        a = krutil.empty((1024, 1024))
        with krutil.start() as session, Bytes() as count:
            for n in range(5):
                a[:] = n
                self.assertEqual(float(session.call("numpy.sum", a, timeout=PATIENCE)), n * 1024 * 1024)
            self.assertLess(count.sent, 8 * KiB)
            self.assertGreater(count.sent, 5 * 100)
            self.await_returns(session)

    def test_a_result_is_not_received(self):
        a = krutil.empty(MiB)
        a[:] = 1
        with krutil.start() as session:
            # The first result of a size comes as bytes.
            session.call("numpy.negative", a, timeout=PATIENCE)
            with Bytes() as count:
                for n in range(5):
                    result = session.call("numpy.multiply", a, n, timeout=PATIENCE)
                    self.assertTrue((result == n).all())
                    # What is written to it stays here.
                    result[:] = -1
                    del result
                self.assertLess(count.received, 8 * KiB)

    def test_results_that_are_kept_stay_as_they_are(self):
        with krutil.start() as session:
            kept = [session.call("numpy.full", MiB, float(n), timeout=PATIENCE) for n in range(6)]
        for n, result in enumerate(kept):
            self.assertTrue((result == n).all())

    def test_results_that_a_program_keeps_go_with_it(self):
        class Program:
            """Refers to its results, and the session to it."""

            def __init__(self):
                with krutil.start(on_input=self.answer) as session:
                    # The first of a size travels as bytes.
                    self.results = [session.call("numpy.zeros", SIZE, timeout=PATIENCE) for _ in range(3)]

            def answer(self, question):
                return ""

        def mapped():
            with open("/proc/self/maps", encoding="utf-8") as maps:
                return sum("/memfd:" in line for line in maps)
        gc.collect()
        before = mapped()
        program = Program()
        self.assertGreater(mapped(), before)
        del program
        gc.collect()
        self.assertEqual(mapped(), before)

    def test_descriptors_are_closed(self):
        a = krutil.empty(MiB)
        with krutil.start() as session:
            before = len(os.listdir("/proc/self/fd"))
            kept = [session.call("numpy.negative", a, timeout=PATIENCE) for _ in range(6)]
            self.assertEqual(len(os.listdir("/proc/self/fd")), before)
            del kept

    def test_orders_types_and_parts(self):
        with krutil.start() as session:
            fortran = krutil.empty((512, 1024), numpy.float32, order="F")
            self.assertTrue(fortran.flags.f_contiguous)
            fortran[:] = numpy.arange(1024)
            pages = krutil.empty(SIZE, numpy.uint8)
            pages[:] = numpy.arange(SIZE) % 251
            for argument, lent in ((fortran, 1), (fortran.T, 1), (pages[4096:4096 + MiB], 1), (pages[1:1 + MiB], 0),
                                   (pages[::2], 0), (pages[:MiB - 1], 0), (pages.view(numpy.int16), 1)):
                with mock.patch.object(shared.Lender, "lend", autospec=True, side_effect=shared.Lender.lend) as lend:
                    result = session.call("numpy.positive", argument, timeout=PATIENCE)
                self.assertEqual((result.dtype, lend.call_count), (argument.dtype, lent))
                self.assertTrue((result == argument).all())

    def test_memory_begins_where_large_pages_can_begin(self):
        a = krutil.empty(2 * SIZE, numpy.uint8)
        with krutil.start() as session:
            # The first result of a size comes as bytes.
            session.call("numpy.negative", a, timeout=PATIENCE)
            result = session.call("numpy.negative", a, timeout=PATIENCE)
        self.assertEqual([each.ctypes.data % (2 * MiB) for each in (a, result)], [0, 0])

    def test_what_is_small_is_an_array_like_any_other(self):
        self.assertIs(krutil.empty(3).base, None)
        self.assertEqual(krutil.empty((2, 0, 3)).shape, (2, 0, 3))
        self.assertRaises(TypeError, krutil.empty, SIZE, "no type")

    def test_without_shared_memory_at_the_engine(self):
        a = krutil.empty(MiB)
        a[:] = 3
        with krutil.start("krutil-qvm --stdio --no-shared-memory") as session:
            self.assertFalse(session._dispatch._settled.shares)
            self.assertTrue((session.call("numpy.negative", a, timeout=PATIENCE) == -3).all())

    def test_a_function_that_keeps_its_argument(self):
        a = krutil.empty(MiB)
        a[:] = 3
        with krutil.start() as session:
            session.eval("kept = []", timeout=PATIENCE)
            session.call("kept.append", a, outputs=0, timeout=PATIENCE)
            self.assertEqual(list(session._dispatch._lender._lent), [1])
            session.eval("kept.clear()", timeout=PATIENCE)
            self.await_returns(session)

    def await_returns(self, session):
        def look():
            session.eval("1", timeout=PATIENCE)
            return not session._dispatch._lender._lent

        eventually(look, "what was lent")


def memory(size=SIZE, seals=1 | 2 | 4 | 16, filled=True, content=b""):
    descriptor = os.memfd_create("test", os.MFD_CLOEXEC | os.MFD_ALLOW_SEALING)
    if filled:
        os.posix_fallocate(descriptor, 0, size)
    else:
        os.ftruncate(descriptor, size)
    os.pwrite(descriptor, content, 0)
    fcntl.fcntl(descriptor, fcntl.F_ADD_SEALS, seals)
    return descriptor


class PlaceTest(unittest.TestCase):
    def test_elements_lie_in_their_own_memory(self):
        array = krutil.empty((2, MiB), numpy.uint8)
        place = shared.Place.of(array[1])
        self.assertEqual((place.memory.address, place.offset, place.size), (array.ctypes.data, MiB, MiB))
        self.assertIsNone(shared.Place.of(numpy.empty(MiB, numpy.uint8)))

    def test_memory_that_goes_is_not_found(self):
        array = krutil.empty(2 * MiB, numpy.uint8)
        address = array.ctypes.data
        unmap, found = shared._libc.munmap, []

        def observed(begin, size):
            # Arrays of other threads may lie here from now on.
            if begin == address:
                elements = types.SimpleNamespace(nbytes=MiB, __array_interface__={"data": (address + MiB, False)})
                found.append(shared.Place.of(elements))
            return unmap(begin, size)

        with mock.patch.object(shared, "_libc", mock.Mock(wraps=shared._libc, munmap=observed)):
            del array
        self.assertEqual(found, [None])

    def test_threads_find_their_own_memory(self):
        found = []

        def look():
            for size in [MiB, 4 * MiB] * 100:
                array = krutil.empty(size, numpy.uint8)
                place = shared.Place.of(array)
                found.append(place is not None and place.memory.address == array.ctypes.data)

        interval = sys.getswitchinterval()
        sys.setswitchinterval(1e-6)
        try:
            threads = [threading.Thread(target=look) for _ in range(4)]
            for thread in threads:
                thread.start()
            for thread in threads:
                thread.join()
        finally:
            sys.setswitchinterval(interval)
        self.assertEqual(found, [True] * 800)


class SharingEngine(ScriptedEngine):
    """A script that shares memory."""

    def greet(self, token=None, descriptors=None, answer=b"\1"):
        greeting = hello()
        greeting.features.add(name="SHM", value="descriptors", handling=1)
        self._reader.descriptors = wire.DescriptorQueue()
        self.send(first(greeting) + verdict(features=(("SHM", "descriptors"), ("ZEROCOPY", "enable"))))
        self.read_greeting()
        probe = memory(mmap.PAGESIZE)
        token = bytes(8) if token is None else token
        self.send_with(token, [probe] if descriptors is None else descriptors)
        os.close(probe)
        self.probed = shared.Probe.shows(self._reader.descriptors, self._reader.read(8, "token"))
        self.send(answer)
        self.answer = bytes(self._reader.read(1, "answer"))

    def send_with(self, data, descriptors):
        socket.send_fds(self._socket, [data], descriptors)

    def read_raw(self, size):
        return bytes(self._reader.read(size, "bytes"))


def shared_frame(number=1, offset=0, size=SIZE, content=None, **options):
    content = struct.pack("<QQQ", number, offset, size) if content is None else content
    return frame(None, content, kind=5, last=False, frame_type=4, **options)


def call_reply(stream, size=SIZE):
    """What follows the frame of the elements."""
    array = schema.Array(elementType=7, dimensions=[size], order=1, dataID=1)
    outcome = schema.FEvalResult(dataIDs=[2])
    outcome.iipResult.id.lo = 1
    return (frame("krutil:QDA", array.SerializeToString(), stream, 2, False)
            + frame("krutil:FEvalResult", outcome.SerializeToString(), stream, 3, False)
            + frame("krutil:IIPReply", reply(3).SerializeToString(), stream, 4))


class ScriptTest(unittest.TestCase):
    def descriptor(self, made):
        self.addCleanup(os.close, made)
        return made

    def session(self, script, **options):
        def whole(engine):
            engine.greet()
            script(engine)

        self.engine = engine = SharingEngine(whole)
        self.addCleanup(engine.join)
        return krutil.Session(engine.connection, timeout=PATIENCE, **options)

    def violation(self, data, text, descriptors=(), limits=krutil.Limits()):
        """The engine answers a call with these bytes and descriptors."""
        aborts = []

        def script(engine):
            engine.read_message()
            engine.send_with(data, list(descriptors))
            aborts.append(engine.read_abort())

        session = self.session(script, limits=limits)
        request = session.submit_call("f")
        with self.assertRaises(krutil.Aborted) as caught:
            request.result(PATIENCE)
        self.assertEqual(str(caught.exception), f"the engine broke the protocol: {text}")
        session.kill()
        self.engine.join()
        self.assertEqual(aborts, [text])

    def test_a_result_that_is_lent_and_returned(self):
        def script(engine):
            descriptor = memory(content=b"\7" * SIZE)
            stream = engine.read_message().stream
            engine.send_with(shared_frame(number=77, stream=stream), [descriptor])
            os.close(descriptor)
            engine.send(call_reply(stream))
            returned.append(engine.read_raw(24))
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        for forks, kind in ((False, 0), (True, 1)):
            returned = []
            with self.session(script) as session:
                result = session.call("f", timeout=PATIENCE)
                self.assertTrue((result == 7).all())
                if forks:
                    child = os.fork()
                    if child == 0:
                        os._exit(0)
                    os.waitpid(child, 0)
                part = result[5:10]
                del result
                self.assertEqual(part.tolist(), [7] * 5)
                del part
            self.engine.join()
            self.assertEqual(returned, [wire.HEADER.pack(6, kind, 0, 0, 77, 0)])

    def test_an_argument_that_is_lent(self):
        a = krutil.empty(SIZE, numpy.uint8)
        a[:] = 9
        seen = []

        def script(engine):
            for kind in (0, 1):
                header = wire.HEADER.unpack(engine.read_raw(24))
                seen.append(header[:3] + header[4:])
                number, offset, size = struct.unpack("<QQQ", engine.read_raw(24))
                descriptor = engine._reader.descriptors.take()
                shared._check(descriptor, offset, size, "the argument")
                with mmap.mmap(descriptor, size, mmap.MAP_PRIVATE) as mapped:
                    seen.append((number, offset, size, mapped[:] == b"\x09" * SIZE))
                os.close(descriptor)
                # What is left of the message begins with its second frame.
                while True:
                    kind_, _, tag, stream, _, content = wire.HEADER.unpack(engine.read_raw(24))
                    engine.read_raw(tag), engine.read_raw(content)
                    if kind_ & 0x80:
                        break
                engine.send(wire.HEADER.pack(6, kind, 0, 0, number, 0) + message(stream, *DONE))
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        with self.session(script) as session:
            for _ in range(2):
                session.call("f", a, outputs=0, timeout=PATIENCE)
                self.assertEqual(session._dispatch._lender._lent, {})
        self.assertEqual(seen, [(5, 4, 0, 1, 24), (1, 0, SIZE, True), (5, 4, 0, 1, 24), (2, 0, SIZE, True)])

    def test_memory_that_breaks_a_rule(self):
        place = "shared content of frame 1 on stream 1: "
        whole = memory(), memory(seals=1 | 2 | 4), memory(filled=False)
        good, weak, hollow = (self.descriptor(each) for each in whole)
        read, write = (self.descriptor(each) for each in os.pipe())
        unreadable = self.descriptor(os.open(f"/proc/self/fd/{good}", os.O_WRONLY))
        for descriptors, options, text in (
                ([], {}, "expected a descriptor, got none"),
                ([good], {"size": MiB - 1}, "expected 1048576 bytes or more, got 1048575"),
                ([write], {}, "expected a descriptor of anonymous memory, got one of another kind"),
                ([weak], {}, "expected the seals SHRINK, GROW, FUTURE_WRITE, SEAL, got SHRINK, GROW, SEAL"),
                ([good], {"offset": 1, "size": MiB}, "expected 1 byte or more from a multiple of 4096 on, got 1048576 "
                                                     "bytes from 1 on"),
                ([good], {"offset": 4096}, f"expected {SIZE} bytes from 4096 on, got memory of {SIZE} bytes"),
                ([good], {"size": 2**64 - 1, "offset": 2**64 - 4096},
                 f"expected {2**64 - 1} bytes from {2**64 - 4096} on, got memory of {SIZE} bytes"),
                ([hollow], {}, f"expected {SIZE} allocated bytes, got 0"),
                ([unreadable], {}, "expected memory that can be mapped, got Permission denied")):
            with self.subTest(text=text):
                self.violation(shared_frame(stream=1, **options), place + text,
                               descriptors)

    def test_a_frame_that_is_none(self):
        self.violation(shared_frame(stream=1, content=b"x" * 23),
                       "content of a shared data frame (frame 1 on stream 1): expected 24 bytes, got 23")
        self.violation(frame(None, kind=7), "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye), 4 (abort), "
                                            "5 (shared data) or 6 (return), got 7")

    def test_contents_count_for_the_limit_of_a_message(self):
        good = self.descriptor(memory())
        self.violation(shared_frame(stream=1), 'message with frame 1 on stream 1 exceeds the limit "message": expected at '
                                               f"most {MiB} bytes, got 0 bytes and a content of {SIZE}",
                       [good], krutil.Limits(message=MiB))

    def test_descriptors_without_frames(self):
        good = self.descriptor(memory())
        self.violation(frame("krutil:Later", stream=1)[:10],
                       "expected at most 32 descriptors ahead of the frames that need them, got 33", [good] * 33)
        self.violation(frame("krutil:Later", stream=1)[:10],
                       "expected at most 32 descriptors at once, and as many as this process may still open; some are lost",
                       [good] * 60)

    def test_returns(self):
        self.violation(wire.HEADER.pack(6, 0, 0, 0, 1, 0),
                       "return frame: expected the number of a content that is lent, got 1")
        wrong = "return frame: expected frame type 0 or 1, and last bit, tag size, stream ID and content size 0"
        for header in ((6, 2, 0, 0, 1, 0), (0x86, 0, 0, 0, 1, 0), (6, 0, 1, 0, 1, 0), (6, 0, 0, 1, 1, 0), (6, 0, 0, 0, 1, 1)):
            self.violation(wire.HEADER.pack(*header), wrong)
        self.violation(frame(None, b"", 1, 1, last=False) + wire.HEADER.pack(6, 0, 0, 0, 1, 0),
                       "return frame in the middle of a message: expected frame 2")

    def test_without_shared_memory_its_frames_are_violations(self):
        def script(engine):
            engine.greet()
            engine.read_message()
            engine.send(shared_frame(stream=1))
            self.assertEqual(engine.read_abort(),
                             "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 5")

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, timeout=PATIENCE)
        self.assertRaises(krutil.Aborted, session.submit_call("f").result, PATIENCE)
        session.kill()
        engine.join()

    def probe(self, expected_answer, shares, **options):
        def script(engine):
            engine.greet(**options)
            self.assertEqual((engine.probed, engine.answer), (True, expected_answer))
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        engine = SharingEngine(script)
        with krutil.Session(engine.connection, timeout=PATIENCE) as session:
            self.assertEqual(session._dispatch._settled.shares, shares)
        engine.join()

    def test_the_probe(self):
        self.probe(b"\1", True)
        self.probe(b"\1", False, answer=b"\0")
        self.probe(b"\0", False, token=b"another!")
        self.probe(b"\0", False, descriptors=[])
        two = [self.descriptor(memory(mmap.PAGESIZE)) for _ in range(2)]
        self.probe(b"\0", False, descriptors=two)
        self.probe(b"\0", False, descriptors=[self.descriptor(memory(mmap.PAGESIZE, seals=1))])

    def test_an_answer_to_the_probe_that_is_none(self):
        engine = SharingEngine(lambda engine: engine.greet(answer=b"\2"))
        with self.assertRaises(krutil.Aborted) as caught:
            krutil.Session(engine.connection, timeout=PATIENCE)
        self.assertEqual(str(caught.exception), "the engine broke the protocol: the peer's answer to the probe of shared "
                                                "memory: expected 0 or 1, got 2")
        engine.connection.close()
        engine.join()


if __name__ == "__main__":
    unittest.main()
