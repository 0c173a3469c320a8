"""Messages are read the same wherever the stream happens to cut their bytes."""

import unittest
from unittest import mock

import krutil
from krutil import parts, schema, wire
from scripted import DONE, frame, message


class Stream:
    """What a reader has of a socket: these pieces, one for each read, and then the end."""

    def __init__(self, pieces):
        self._pieces = [piece for piece in pieces if piece]
        self.reads = 0

    def recv_into(self, target, size=0, flags=0):
        self.reads += 1
        if not self._pieces:
            return 0
        piece = self._pieces[0][:len(target)]
        target[:len(piece)] = piece
        self._pieces[0] = self._pieces[0][len(piece):]
        if not self._pieces[0]:
            del self._pieces[0]
        return len(piece)


def outcome(pieces, limits=krutil.Limits()):
    """Stream ID and frames of each message; what breaks the protocol is the last one."""
    reader, read = wire.Reader(Stream(pieces)), []
    try:
        while (each := wire.read_message(reader, limits)) is not None:
            read.append((each.stream, each.root, [(got.tag, got.type, bytes(got.content)) for got in each._frames]))
    except wire.Violation as violation:
        read.append(str(violation))
    return read


class MessageTest(unittest.TestCase):
    def same_wherever_it_is_cut(self, data, expected, limits=krutil.Limits()):
        self.assertEqual(outcome([data], limits), expected)
        self.assertEqual(outcome([data[at:at + 1] for at in range(len(data))], limits), expected)
        for at in range(1, len(data)):
            self.assertEqual(outcome([data[:at], data[at:]], limits), expected)

    def test_messages_of_several_frames(self):
        data = message(7, ("krutil:A", b"one", 3), ("krutil:B", b""), ("krutil:C", b"three")) + message(8, ("krutil:D", b"4"))
        self.same_wherever_it_is_cut(data, [
            (7, "krutil:C", [("krutil:A", 3, b"one"), ("krutil:B", 29, b""), ("krutil:C", 29, b"three")]),
            (8, "krutil:D", [("krutil:D", 29, b"4")])])

    def test_data_frames_and_arrays(self):
        data = frame(None, b"elements", 7, 1, False) + frame("krutil:QDA", b"array", 7, 2, False) + frame("krutil:R", b"", 7, 3)
        self.same_wherever_it_is_cut(data, [(7, "krutil:R", [(None, 29, b"elements"), ("krutil:QDA", 29, b"array"),
                                                             ("krutil:R", 29, b"")])])

    def test_what_is_wrong_in_a_later_frame(self):
        begin = frame("krutil:A", b"one", 7, 1, False)
        limits = krutil.Limits(tag=10, tagged_frame=8, array_message=4, message=100, frames=3)
        for second, text in (
                (frame("x", stream=8, index=2),
                 "stream ID of frame 2: expected 7 as in the frames before it in its message, got 8"),
                (frame("x", stream=7, index=3), "frame index: expected 2, got 3"),
                (frame("", stream=7, index=2, kind=1),
                 "tag of a tagged frame (frame 2 on stream 7): expected at least 1 byte, got none"),
                (frame("x" * 11, stream=7, index=2),
                 'tag of frame 2 on stream 7 exceeds the limit "tag": expected at most 10 bytes, got 11'),
                (frame("x", b"123456789", 7, 2), 'content of frame 2 with tag "x" exceeds the limit "taggedFrame": '
                                                 'expected at most 8 bytes, got 9'),
                (frame("krutil:QDA", b"12345", 7, 2), 'content of frame 2 with tag "krutil:QDA" exceeds the limit '
                                                      '"arrayMessage": expected at most 4 bytes, got 5'),
                (frame("x", b"", 7, 2, False) + frame("x", b"", 7, 3, False) + frame("x", b"", 7, 4),
                 'number of frames of a message exceeds the limit "frames": expected at most 3 frames, got 4'),
                (frame("x", stream=7, index=2, kind=9), "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 "
                                                        "(abort), got 9")):
            self.same_wherever_it_is_cut(begin + second, [text], limits)
        self.same_wherever_it_is_cut(
            begin + frame("x" * 10, b"12345678", 7, 2),
            ['message with frame 2 on stream 7 exceeds the limit "message": expected at most 28 bytes, '
             'got 21 bytes and a content of 8'], krutil.Limits(message=28))

    def test_a_reply_that_has_arrived_is_taken_in_one_step(self):
        stream = Stream([message(1, *DONE)])
        with mock.patch.object(wire.Reader, "read", side_effect=AssertionError("a step for a part of a message")):
            read = wire.read_message(wire.Reader(stream), krutil.Limits())
        self.assertEqual((read.root, stream.reads), ("krutil:IIPReply", 1))


class PartsTest(unittest.TestCase):
    """In the content of a result, whose field 1 has numbers, and whose field 2 is an error with errors in field 6."""

    def expect(self, content, *begins):
        """Its fields begin at these bytes; one that is refused is the first beyond a limit."""
        for most, begin in enumerate((*begins, None)):
            self.assertEqual(parts.first_beyond(schema.IIPResult.DESCRIPTOR, memoryview(content), most), begin)

    def test_fields_of_messages_inside_count(self):
        self.expect(b"")
        self.expect(b"\x0a\x02\x10\x01\x12\x04\x32\x02\x32\x00", 0, 2, 4, 6, 8)
        self.expect(b"\x12\x02\x32\x00\x12\x02\x32\x00", 0, 2, 4, 6)

    def test_bytes_of_others_do_not(self):
        self.expect(b"\x12\x04\x1a\x02\x32\x00", 0, 2)
        self.expect(b"\x7a\x02\x32\x00\x09" + b"\x08" * 8 + b"\x0d" + b"\x08" * 4 + b"\x08\xff\x01\x08\x01", 0, 4, 13, 18, 21)

    def test_groups_are_fields_and_have_some(self):
        self.expect(b"\x13\x12\x02\x32\x00\x14\x12\x02\x32\x00", 0, 1, 6, 8)

    def test_what_is_not_whole_has_the_fields_before(self):
        for fault in (b"\x80", b"\x0f", b"\x14", b"\x08" + b"\xff" * 11):
            self.expect(b"\x08\x01" + fault, 0, *([] if fault in (b"\x80", b"\x14") else [2]))
        self.expect(b"\x12\x05\x32\x00", 0)


if __name__ == "__main__":
    unittest.main()
