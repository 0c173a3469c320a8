"""What engines do that break the protocol, and what the client makes of it. No engine takes part."""

import struct
import threading
import unittest

import krutil
from krutil import schema
from eventually import PATIENCE
from scripted import (DONE, GREETING, MAGIC, SHUTDOWN, ScriptedEngine, first, frame, hello, message, reply, result,
                      verdict)

KiB, MiB = 1 << 10, 1 << 20


def text_event(stream, kind="krutil:TextBaseEvent"):
    return (kind, schema.TextBaseEvent(text="x", stream=stream))


def array(**fields):
    return schema.Array(**{"elementType": 5, "order": 1, **fields})


def call_reply(*frames, ids=(1,), stream=1):
    """The reply to a call: frames of arrays, and what refers to the frames at `ids`."""
    outcome = schema.FEvalResult(dataIDs=ids)
    outcome.iipResult.id.lo = 1
    return message(stream, *frames, ("krutil:FEvalResult", outcome), ("krutil:IIPReply", reply(len(frames) + 1)))


class HandshakeTest(unittest.TestCase):
    def begin(self, *said, error, text, after=lambda engine: None, timeout=PATIENCE):
        """Begins a session with an engine that says this, and expects an error."""
        def script(engine):
            engine.send(b"".join(said))
            after(engine)

        engine = ScriptedEngine(script)
        with engine.connection, self.assertRaises(error) as caught:
            krutil.Session(engine.connection, timeout=timeout)
        self.assertEqual(str(caught.exception), text)
        engine.join()

    def violation(self, *said, text):
        self.begin(*said, error=krutil.Aborted, text=f"the engine broke the protocol: {text}")

    def test_another_program(self):
        self.violation(b"sh: 1: krutil-qvm: not found\n",
                       text='the peer does not speak this protocol: expected a first message that begins with '
                            '"\\x89KRUTIL\\n", got "sh: 1: krutil-qvm: not found"')

    def test_magic_that_differs_in_its_last_byte(self):
        self.violation(MAGIC[:-1] + b"\r",
                       text='the peer does not speak this protocol: expected a first message that begins with '
                            '"\\x89KRUTIL\\n", got "\\x89KRUTIL"')

    def test_hello_of_any_length(self):
        self.violation(MAGIC, struct.pack("<II", 1, 65537),
                       text="length of the peer's hello: expected at most 65536 bytes, got 65537")

    def test_hello_that_is_no_message(self):
        self.violation(MAGIC, struct.pack("<II", 1, 2), b"\xff\xff",
                       text="the peer's hello: its 2 bytes are not a message of its type")

    def test_hello_without_limits(self):
        without = hello()
        without.ClearField("limits")
        self.violation(first(without), text="the peer's hello: expected the limits of the peer, got none")

    def test_verdict_of_any_length(self):
        self.violation(first(), struct.pack("<I", 1 << 31),
                       text="length of the peer's verdict: expected at most 65536 bytes, got 2147483648")

    def test_verdict_that_is_no_message(self):
        self.violation(first(), struct.pack("<I", 1), b"\x08",
                       text="the peer's verdict: its 1 bytes are not a message of its type")

    def test_stream_that_ends_in_the_first_message(self):
        self.begin(error=krutil.Lost, text="the engine has gone before it said anything")
        self.begin(MAGIC[:3], error=krutil.Lost, text="the engine has gone during the handshake: the stream ended after 3 "
                                                      "of the 8 bytes of the beginning of the engine's first message")
        self.begin(MAGIC, error=krutil.Lost, text="the engine has gone during the handshake: the stream ended after 0 of "
                                                  "the 4 bytes of the layout of the engine's first message")

    def test_stream_that_ends_in_the_hello(self):
        self.begin(MAGIC, struct.pack("<II", 1, 10), b"abc", error=krutil.Lost,
                   text="the engine has gone during the handshake: the stream ended after 3 of the 10 bytes of the "
                        "engine's hello")

    def test_silence(self):
        done = threading.Event()
        self.addCleanup(done.set)

        def script(engine):
            done.wait(PATIENCE)

        engine = ScriptedEngine(script)
        with engine.connection, self.assertRaises(krutil.Lost) as caught:
            krutil.Session(engine.connection, timeout=0.05)
        self.assertEqual(str(caught.exception), "the engine did not finish the handshake within 0.05 seconds")

    def refusal(self, message, text, layout=1):
        def verdict_is_read(engine):
            said = engine.read_greeting()[1]
            assert not said.accepted and said.refusal == text, said
            engine.send(verdict(False, "so be it"))

        self.begin(first(message, layout), error=krutil.Refused, text=f"the engine does not fit: {text}",
                   after=verdict_is_read)

    def test_another_layout(self):
        self.refusal(hello(), "layout version: the client has 1, the engine 2", layout=2)

    def test_another_protocol_and_version(self):
        self.refusal(hello(protocol="other", versionMajor=2, versionMinor=1),
                     "protocol: the client has krutil, the engine other; version: the client has 1.0, the engine 2.1")

    def test_another_client(self):
        self.refusal(hello(role=0), "both ends are clients")

    def test_no_value_of_a_required_feature(self):
        other = hello()
        other.features[0].value = "perhaps"
        self.refusal(other, 'feature "ZEROCOPY": there is no value that both ends accept')

    def test_engine_that_refuses(self):
        self.begin(first(), verdict(False, "no more sessions"), error=krutil.Refused,
                   text="the engine refuses the session: no more sessions")

    def test_engine_that_has_settled_on_something_else(self):
        self.begin(first(), verdict(features=[("ZEROCOPY", "disable")]), error=krutil.Refused,
                   text="the engine has settled on other features than this end")

    def test_unknown_optional_features_and_capabilities_do_no_harm(self):
        more = hello(build="of tomorrow")
        more.features.add(name="LATER", value="on", handling=1)
        more.capabilities.extend([0, 99])

        def script(engine):
            engine.send(first(more) + verdict())
            engine.read_greeting()
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        engine = ScriptedEngine(script)
        krutil.Session(engine.connection, timeout=PATIENCE).close(PATIENCE)
        engine.join()


class ViolationTest(unittest.TestCase):
    def play(self, said, error, text, abort, call=False, limits=krutil.Limits(), ends=True):
        """The engine answers the first request with these bytes. The request fails with the text, the session ends with
        the same, and the engine is told why."""
        aborts = []

        def script(engine):
            engine.greet()
            engine.read_message()
            engine.send(said)
            if ends:
                engine.half_close()
            aborts.append(engine.read_abort())

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, limits=limits, timeout=PATIENCE)
        request = session.submit_call("f") if call else session.submit("1")
        with self.assertRaises(error) as caught:
            request.result(PATIENCE)
        self.assertEqual(str(caught.exception), text)
        with self.assertRaises(error) as caught:
            session.close(PATIENCE)
        self.assertEqual(str(caught.exception), text)
        with self.assertRaises(error):
            session.submit("2")
        engine.join()
        self.assertEqual(aborts, [abort])

    def violation(self, said, text, **options):
        self.play(said, krutil.Aborted, f"the engine broke the protocol: {text}", text, **options)

    # Frames.

    def test_frame_kind(self):
        self.violation(frame("x", kind=5), "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 5")

    def test_goodbye(self):
        self.violation(frame(None, kind=3, frame_type=0, last=False, index=0),
                       "goodbye frame: expected one from clients only, got one from the engine")

    def test_abort_with_a_reason_that_is_too_long(self):
        self.violation(frame(None, kind=4, frame_type=0, last=False, index=0, size=1 << 40),
                       "abort frame: expected a reason of at most 4096 bytes, got 1099511627776")

    def test_first_index(self):
        self.violation(frame("x", index=2), "frame index: expected 1, got 2")

    def test_message_in_a_message(self):
        self.violation(frame("x", stream=1, last=False) + frame("x", stream=2, index=2),
                       "stream ID of frame 2: expected 1 as in the frames before it in its message, got 2")

    def test_tagged_frame_without_tag(self):
        self.violation(frame("", kind=1), "tag of a tagged frame (frame 1 on stream 0): expected at least 1 byte, got none")

    def test_data_frame_with_tag(self):
        self.violation(frame("x", kind=2), "tag of a data frame (frame 1 on stream 0): expected none, got 1 bytes")

    def test_data_frame_as_root(self):
        self.violation(frame(None, stream=3),
                       "message on stream 3: expected a tagged frame as its last one, got a data frame")

    # Sizes that are only claimed.

    def test_long_tag(self):
        self.violation(frame("x" * 129), 'tag of frame 1 on stream 0 exceeds the limit "tag": expected at most 128 bytes, '
                                         'got 129')

    def test_large_tagged_frame(self):
        self.violation(frame("krutil:TextBaseEvent", size=4 * MiB + 1),
                       'content of frame 1 with tag "krutil:TextBaseEvent" exceeds the limit "taggedFrame": expected at '
                       'most 4194304 bytes, got 4194305')

    def test_large_array_in_its_frame(self):
        self.violation(frame("krutil:QDA", size=64 * MiB + 1),
                       'content of frame 1 with tag "krutil:QDA" exceeds the limit "arrayMessage": expected at most '
                       '67108864 bytes, got 67108865')

    def test_large_data_frame(self):
        self.violation(frame(None, size=1 << 62, last=False),
                       'message with frame 1 on stream 0 exceeds the limit "message": expected at most 4294967296 bytes, '
                       'got 0 bytes and a content of 4611686018427387904')

    def test_many_frames(self):
        self.violation(b"".join(frame(None, index=index, last=False) for index in range(1, 5)),
                       'number of frames of a message exceeds the limit "frames": expected at most 3 frames, got 4',
                       limits=krutil.Limits(frames=3))

    def test_many_parts(self):
        # Two bytes make an empty error, which is a large object. Those of a text are one part.
        outcome = result().SerializeToString() + b"\x12\x80\x80\x80\x01" + b"\x32\x00" * MiB
        self.violation(message(1, ("krutil:IIPResult", outcome), ("krutil:IIPReply", reply(1))),
                       f'frame "krutil:IIPResult", byte {len(outcome) - 2 * MiB + 2 * (262_144 - 3)}: expected at most 262144 '
                       'fields (limit "parts"), got more')

    def test_a_size_that_never_comes_takes_no_memory(self):
        claimed = 1 << 30
        before = reset_peak()
        self.play(frame(None, size=claimed, last=False), krutil.Lost,
                  f"the engine has gone: the stream ended after 0 of the {claimed} bytes of the content of frame 1",
                  "no abort")
        self.assertLess(peak() - before, 64 * MiB)

    # Streams that end.

    def test_end_without_the_last_message(self):
        self.play(b"", krutil.Lost, "the engine has gone: the stream ended without the engine's last message", "no abort")

    def test_end_in_a_header(self):
        self.play(frame("x")[:10], krutil.Lost,
                  "the engine has gone: the stream ended after 10 of the 24 bytes of the header of frame 1", "no abort")

    def test_end_between_the_frames_of_a_message(self):
        self.play(frame(None, b"abc", last=False), krutil.Lost,
                  "the engine has gone: the stream ended after 0 of the 24 bytes of the header of frame 2", "no abort")

    def test_abort_of_the_engine(self):
        self.play(frame(None, "I am out of memory – sorry".encode(), kind=4, frame_type=0, last=False, index=0),
                  krutil.Aborted, "the engine has aborted the session: I am out of memory – sorry", "no abort")

    # Roots in the wrong place.

    def test_reply_to_nothing(self):
        self.violation(message(9, *DONE),
                       'message on stream 9: "krutil:IIPReply" is a reply: expected the stream ID of an open exchange')

    def test_answer_to_a_cancel_that_was_not_asked(self):
        self.violation(message(1, ("krutil:IIPCancelReply", b"")),
                       'message on stream 1: "krutil:IIPCancelReply" is a reply: expected the stream ID of an open exchange')

    def test_event_of_nothing(self):
        self.violation(message(9, text_event(0)), 'message on stream 9: "krutil:TextBaseEvent" is an event: expected the '
                                                  'stream ID 0 or that of an open exchange')

    def test_request_of_the_engine(self):
        self.violation(message(1, ("krutil:IIPEnqueueMessage", b"")),
                       'message on stream 1: "krutil:IIPEnqueueMessage" goes to an engine, not to a client')

    def test_part_as_root(self):
        self.violation(message(1, ("krutil:IIPResult", result())),
                       'message on stream 1: "krutil:IIPResult" is only ever referred to and cannot be the last frame')

    def test_unknown_tag(self):
        self.violation(message(1, ("krutil:Later", b"")),
                       'message on stream 1: no serializer is registered for its tag "krutil:Later"')

    def test_message_after_the_last_one(self):
        self.violation(SHUTDOWN + message(0, text_event(0)),
                       "expected nothing after the engine's shutdown event, got another frame")

    # Contents.

    def test_text_stream(self):
        self.violation(message(1, text_event(3)), 'frame "krutil:TextBaseEvent": expected a stream from 0 to 2, got 3')

    def test_status_of_a_cause(self):
        record = schema.IIPResult().exception
        record.status = 2
        record.causes.add(status=6)
        self.violation(message(1, ("krutil:IIPResult", result(exception=record)), ("krutil:IIPReply", reply())),
                       'frame "krutil:IIPResult": expected a status from 0 to 5, got 6')

    def test_prompt_state_and_loop(self):
        self.violation(message(1, ("krutil:DebugLoopEvent", schema.DebugLoopEvent(whichLoop=1))),
                       'cannot read "krutil:DebugLoopEvent": Invalid enum krutil::protobuf::DebugLoopEvent_State field '
                       'value = 0')
        self.violation(message(1, ("krutil:DebugLoopEvent", schema.DebugLoopEvent(whichLoop=12, state=2))),
                       'cannot read "krutil:DebugLoopEvent": Invalid enum krutil::protobuf::InputRequester field value = 12')

    def test_prompt_for_a_client_that_answers_none(self):
        self.violation(message(1, ("krutil:DebugLoopEvent", schema.DebugLoopEvent(whichLoop=2, state=2))),
                       'cannot read "krutil:DebugLoopEvent": the input prompt on stream 1 asks nobody')

    def test_frame_type(self):
        self.violation(message(1, (*text_event(0), 27)), 'cannot read "krutil:TextBaseEvent": frame 1: expected the frame '
                                                         'type of "krutil:TextBaseEvent", got 27')

    def test_reply_without_identifier(self):
        self.violation(message(1, ("krutil:IIPReply", b"")),
                       'cannot read "krutil:IIPReply": Required field is missing: protobuf::IIPReply.id')

    def test_result_that_is_not_there(self):
        self.violation(message(1, ("krutil:IIPReply", reply(7))),
                       'cannot read "krutil:IIPReply": frame 7: expected a frame, got none: the message has 1')

    def test_reply_that_refers_to_itself(self):
        self.violation(message(1, ("krutil:IIPReply", reply(1))),
                       'cannot read "krutil:IIPReply": frame 1: expected a frame, got none: it was read already')

    def test_result_of_another_kind(self):
        self.violation(message(1, text_event(0), ("krutil:IIPReply", reply(1))),
                       'cannot read "krutil:IIPReply": frame 1: expected an object that "krutil:IIPReply" can refer to, '
                       'got one with tag "krutil:TextBaseEvent"')

    def test_result_in_a_data_frame(self):
        self.violation(message(1, (None, b"abc", 11), ("krutil:IIPReply", reply(1))),
                       'cannot read "krutil:IIPReply": frame 1: expected a tagged frame, got a data frame of type 11')

    # Arrays.

    def bad_array(self, *frames, text, ids=(1,)):
        self.violation(call_reply(*frames, ids=ids), f'cannot read "krutil:IIPReply": {text}', call=True)

    def test_elements_that_do_not_match_the_shape(self):
        self.bad_array(("krutil:QDA", array(dimensions=[2, 3], inlineElements=b"1234567")),
                       text="Array: expected 48 bytes of elements for [2, 3], got 7")

    def test_shape_beyond_all_memory(self):
        self.bad_array(("krutil:QDA", array(dimensions=[1 << 40, 1 << 40], inlineElements=b"")),
                       text=f"Array: expected {8 << 80} bytes of elements for [{1 << 40}, {1 << 40}], got 0")

    def test_extent_that_no_array_has(self):
        for extent in ((1 << 63) - 1, (1 << 64) - 1):
            self.bad_array(("krutil:QDA", array(dimensions=[0, extent], inlineElements=b"")),
                           text=f"Array: no array has the dimensions [0, {extent}]")

    def test_dimensions(self):
        self.bad_array(("krutil:QDA", array(dimensions=[1] * 33, inlineElements=b"12345678")),
                       text="Array: expected at most 32 dimensions, got 33")

    def test_element_type(self):
        self.bad_array(("krutil:QDA", array(elementType=3, inlineElements=b"")),
                       text="Array: elements of type 3 are not known")

    def test_order(self):
        self.bad_array(("krutil:QDA", array(order=0, inlineElements=b"12345678")),
                       text="Array: expected the order 1 (row major) or 2 (column major), got 0")

    def test_bool(self):
        self.bad_array(("krutil:QDA", array(elementType=1, dimensions=[2], inlineElements=b"\x01\x02")),
                       text="Array: expected 0 or 1 as an element of type bool")

    def test_no_elements(self):
        self.bad_array(("krutil:QDA", array()), text="Array: there are no elements")

    def test_data_frame_that_two_arrays_share(self):
        shares = ("krutil:QDA", array(dataID=1))
        self.bad_array((None, b"12345678", 11), shares, shares, ids=(2, 3),
                       text="frame 1: expected a frame, got none: it was read already")

    def test_tagged_frame_as_data(self):
        self.bad_array(("krutil:QDA", array(dataID=2)), ("krutil:QDA", array(inlineElements=b"12345678")),
                       text='frame 2: expected a data frame, got a tagged frame with tag "krutil:QDA"')

    def test_data_frame_while_zero_copy_is_off(self):
        off = hello()
        off.features[0].value = "disable"

        def script(engine):
            engine.send(first(off) + verdict(features=[("ZEROCOPY", "disable")]))
            engine.read_greeting()
            engine.read_message()
            engine.send(call_reply((None, b"12345678", 11), ("krutil:QDA", array(dataID=1)), ids=(2,)))
            engine.read_abort()

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, timeout=PATIENCE)
        with self.assertRaises(krutil.Aborted) as caught:
            session.call("f", timeout=PATIENCE)
        self.assertEqual(str(caught.exception), 'the engine broke the protocol: cannot read "krutil:IIPReply": Array: a '
                                                'data ID while zero copy is off')
        session.kill()
        engine.join()


class UnusualTest(unittest.TestCase):
    """What is within the protocol, but not what the engine of this repository does."""

    def with_engine(self, script, **options):
        def whole(engine):
            engine.greet()
            script(engine)
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        engine = ScriptedEngine(whole)
        self.addCleanup(engine.join)
        return krutil.Session(engine.connection, timeout=PATIENCE, **options)

    def test_replies_in_any_order(self):
        def script(engine):
            streams = [engine.read_message().stream for _ in range(3)]
            for stream in reversed(streams):
                text = ("krutil:TextBaseEvent", schema.TextBaseEvent(text=str(stream)))
                engine.send(message(stream, text) + message(stream, *DONE))

        with self.with_engine(script) as session:
            requests = [session.submit(str(number)) for number in range(3)]
            self.assertEqual([each.result(PATIENCE).output for each in requests], ["1", "2", "3"])

    def test_a_reply_byte_by_byte(self):
        def script(engine):
            for byte in message(engine.read_message().stream, *DONE):
                engine.send(bytes([byte]))

        with self.with_engine(script) as session:
            self.assertEqual(session.eval("", timeout=PATIENCE), krutil.Result("", None, ()))

    def test_frames_that_nothing_refers_to_are_ignored(self):
        def script(engine):
            engine.send(message(engine.read_message().stream, (None, b"abc", 11), ("krutil:Later", b"\xff"),
                                ("krutil:IIPResult", result()), ("krutil:IIPReply", reply(3))))

        with self.with_engine(script) as session:
            session.eval("", timeout=PATIENCE)

    def test_a_call_without_outputs(self):
        def script(engine):
            engine.send(message(engine.read_message().stream, *DONE))

        with self.with_engine(script) as session:
            with self.assertRaises(krutil.Refused) as caught:
                session.call("f", timeout=PATIENCE)
            self.assertEqual(str(caught.exception), "the engine has returned 0 outputs; 1 were asked for")

    def test_warnings_are_any_bytes(self):
        def script(engine):
            # Identifier and message are no text; field 4 of a warning's event is its message.
            warning = b"\x0a\x02\xff\xfe" b"\x12\x00" b"\x22\x01\xff" b"\x30\x00" b"\x39" + bytes(8)
            issued = b"\x0a\x00" b"\x12" + bytes([len(warning)]) + warning
            stream = engine.read_message().stream
            engine.send(message(stream, ("korvel:lang:diagnostic:IssuedEnabledWarningEvent",
                                         b"\x0a" + bytes([len(issued)]) + issued, 27)) + message(stream, *DONE))

        with self.with_engine(script) as session:
            self.assertEqual(session.eval("", timeout=PATIENCE).warnings, (krutil.Warned("\ufffd\ufffd", "\ufffd", ()),))

    def test_displays_that_are_none(self):
        answers = {
            "no": "Expecting value: line 1 column 1 (char 0)",
            "[{}]": "a description without what it must have (KeyError('formats'))",
            '[{"number": 1, "formats": [{"type": "image/png", "bytes": 5}]}]': "a picture of 5 bytes, where 4 are left",
            '[{"number": 1, "formats": [{"type": "image/png", "bytes": -1}]}]': "a picture of -1 bytes, where 4 are left",
            "[" * 100_000: "maximum recursion depth exceeded while decoding a JSON array from a unicode string",
        }
        for answer, told in answers.items():
            def script(engine):
                stream = engine.read_message().stream
                line = schema.SinkTextEvent(text="[picture 1: image/png, 2 x 2]\n")
                engine.send(message(stream, ("krutil:SinkTextEvent", line)) + message(stream, *DONE))
                asked = engine.read_message()
                text = array(elementType=2, dimensions=[1, len(answer)], inlineElements=answer.encode("utf-16-le"))
                data = array(elementType=7, dimensions=[4], inlineElements=b"data")
                engine.send(call_reply(("krutil:QDA", text), ("krutil:QDA", data), ids=(1, 2), stream=asked.stream))

            with self.subTest(answer=answer[:50]), self.with_engine(script, on_display=lambda display: None) as session:
                done = session.eval("", timeout=PATIENCE)
                self.assertEqual((done.displays, done.warnings), ((), (krutil.Warned(
                    "RuntimeWarning", f"the pictures are lost: {told}", ()),)))
                # What the line stood for is not there, so it is the text of a value.
                self.assertEqual(done.value, "[picture 1: image/png, 2 x 2]")

    def test_displays_when_the_session_ends_before_they_come(self):
        def script(engine):
            engine.greet()
            stream = engine.read_message().stream
            line = schema.SinkTextEvent(text="[picture 1: image/png, 2 x 2]\n")
            engine.send(message(stream, ("krutil:SinkTextEvent", line)) + message(stream, *DONE) + SHUTDOWN)

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, on_display=lambda display: None, timeout=PATIENCE)
        done = session.eval("", timeout=PATIENCE)
        self.assertEqual([warned.message for warned in done.warnings],
                         ["the pictures are lost: the engine has ended the session"])
        session.close(PATIENCE)
        engine.join()

    def test_an_engine_that_ends_by_itself(self):
        def script(engine):
            engine.greet()
            engine.read_message()
            engine.send(SHUTDOWN)

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, timeout=PATIENCE)
        request = session.submit("1")
        with self.assertRaises(krutil.Lost) as caught:
            request.result(PATIENCE)
        self.assertEqual(str(caught.exception), "the engine has ended the session")
        session.close(PATIENCE)
        with self.assertRaises(krutil.Lost):
            session.submit("2")
        engine.join()

    def test_an_engine_that_reads_nothing_is_left_behind(self):
        go = threading.Event()

        def script(engine):
            engine.send(GREETING)
            engine.read_greeting()
            go.wait(PATIENCE)

        engine = ScriptedEngine(script)
        session = krutil.Session(engine.connection, timeout=PATIENCE)
        requests = [session.submit_call("f", bytes_of(MiB)) for _ in range(16)]
        session.kill()
        for request in requests:
            with self.assertRaises(krutil.Lost):
                request.result(PATIENCE)
        go.set()
        engine.join()


def bytes_of(size):
    import numpy

    return numpy.zeros(size, numpy.uint8)


def peak():
    """The most memory that this process has had at a time."""
    with open("/proc/self/status", encoding="ascii") as file:
        return next(int(line.split()[1]) * KiB for line in file if line.startswith("VmHWM"))


def reset_peak():
    """From now on only. Returns what the process has."""
    with open("/proc/self/clear_refs", "w", encoding="ascii") as file:
        file.write("5")
    return peak()


if __name__ == "__main__":
    unittest.main()
