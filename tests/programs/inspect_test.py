"""krutil inspect: recordings of real sessions, and ones made of bytes that a test gives.

    inspect_test.py SCHEMA KRUTIL [TEST...]
"""

import json
import os
import struct
import subprocess
import sys
import tempfile
import unittest

import jsonschema

from recorded_session import (GOODBYE, IIP, SHUTDOWN, field, frame, hello, recorded, reply, request, text, varint,
                              verdict)
from recordings import INBOUND, OUTBOUND, Recording

SCHEMA, KRUTIL = sys.argv[1:3]
PATIENCE = 100


class InspectTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        cls.directory = directory.name
        cls.file = os.path.join(cls.directory, "session.pcapng")
        with open(SCHEMA, encoding="utf-8") as file:
            schema = json.load(file)
        jsonschema.Draft202012Validator.check_schema(schema)
        cls.schema = jsonschema.Draft202012Validator(schema)
        cls.members = {name: set(part.get("properties", {})) for name, part in schema["$defs"].items()}
        cls.real = os.path.join(cls.directory, "real.pcapng")
        subprocess.run([KRUTIL, "call", "--record", cls.real, "numpy.zeros", "300000"], check=True, timeout=PATIENCE,
                       stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL)

    def write(self, recording):
        with open(self.file, "wb") as file:
            file.write(recording if isinstance(recording, bytes) else recording.bytes())

    def inspect(self, *options, file=None, exit_code=0, stdin=subprocess.DEVNULL):
        """What is on standard output and standard error."""
        done = subprocess.run([KRUTIL, "inspect", *options, file or self.file], stdin=stdin, stdout=subprocess.PIPE,
                              stderr=subprocess.PIPE, encoding="utf-8", timeout=PATIENCE, check=False)
        self.assertEqual(done.returncode, exit_code, done.stdout + done.stderr)
        return done.stdout, done.stderr

    def objects(self, *options, **rest):
        found = [json.loads(line) for line in self.inspect("--json", *options, **rest)[0].splitlines()]
        for each in found:
            self.assertEqual([error.message for error in self.schema.iter_errors(each)], [], each)
            self.assertLessEqual(set(each), self.members[each["event"]])
            for part in each.get("frames", []):
                self.assertLessEqual(set(part), self.members["frame"])
        return found

    def test_a_line_a_message(self):
        hostile = text(1, b"1\n\x1b[2J\xc2\x9b\xe2\x80\xae\"")
        self.write(recorded((">", request()), ("<", hostile), ("<", reply()), (">", GOODBYE), ("<", SHUTDOWN)))
        size = [len(unit) for unit in (hello(0), verdict(), b"".join(request()), hostile, b"".join(reply()), GOODBYE,
                                       SHUTDOWN)]
        self.assertEqual(self.inspect()[0].splitlines(), [
            'session 0, recorded by "client 4711", ""',
            f'    0.000000 --> -        hello, {size[0]} bytes: "test\\x1b[31m"',
            f'    0.000001 <-- -        hello, {size[0]} bytes: "test\\x1b[31m"',
            f"    0.000002 --> -        verdict, {size[1]} bytes: accepted",
            f"    0.000003 <-- -        verdict, {size[1]} bytes: accepted",
            f'    0.000004 --> 00000000 IIPEnqueueMessage, {size[2]} bytes: eval "print(1)"',
            f'    0.000006 <-- 00000000 TextBaseEvent, {size[3]} bytes: output "1\\n\\x1b[2J\\x9b\\u202e\\""',
            f"    0.000007 <-- 00000000 IIPReply, {size[4]} bytes: ok",
            f"    0.000009 --> -        goodbye, {size[5]} bytes",
            f"    0.000010 <-- -        QVMShutdownEvent, {size[6]} bytes"])

    def test_frames_fields_and_bytes(self):
        self.write(recorded((">", request())))
        lines = self.inspect("--hex", "--type", "IIPEnqueueMessage")[0].splitlines()
        self.assertRegex(lines[2], r"^      byte \d+: stream 1 frame 1 type 29 krutil:EvalIIP, \d+ bytes$")
        self.assertEqual(lines[3], "        00000000  01 1d 0e 00 01 00 00 00 01 00 00 00 00 00 00 00  ................")
        fields = self.inspect("--fields", "--type", "IIPEnqueueMessage")[0]
        self.assertIn('        cmd: "print(1)"\n', fields)
        self.assertIn("        dequeueMode: DEQUEUE_AT_IDLE\n", fields)
        self.assertNotIn("00000010", fields)
        message = self.objects("--fields", "--hex", "--type", "IIPEnqueueMessage")[1]
        self.assertEqual([part["tag"] for part in message["frames"]], ["krutil:EvalIIP", "krutil:IIPEnqueueMessage"])
        self.assertEqual(message["frames"][0]["fields"]["cmd"], "print(1)")
        self.assertEqual(bytes.fromhex(message["frames"][0]["bytes"]), request()[0])

    def test_filters(self):
        self.write(recorded((">", request(1, b"a", 1)), (">", request(2, b"b", 2)), ("<", reply(2)), ("<", reply(1))))
        def types(*options):
            return [each["type"] for each in self.objects(*options) if each["event"] == "message"]
        self.assertEqual(types("--request", "0" * 31 + "2"), ["IIPEnqueueMessage", "IIPReply"])
        self.assertEqual(len(types("--request", "0")), 4)
        self.assertEqual(types("--type", "IIPReply", "--type", "verdict", "--from", "engine"),
                         ["verdict", "IIPReply", "IIPReply"])
        self.assertEqual(types("--since", "0.0000085"), ["IIPReply"] * 1)
        self.assertEqual(types("--until", "0.0000015"), ["hello", "hello"])

    def test_timelines_of_requests(self):
        self.write(recorded((">", request()), ("<", text(1, b"a")), ("<", text(1, b"b")), ("<", reply()),
                            (">", request(2, b"never", 7))))
        size = len(text(1, b"a"))
        lines = self.inspect("--timeline")[0].splitlines()
        self.assertEqual(lines[0], 'request ' + "0" * 26 + 'abcdef: eval "print(1)"')
        self.assertRegex(lines[1], r"^   \+0\.000000 --> IIPEnqueueMessage, \d+ bytes$")
        self.assertEqual(lines[2], f'   +0.000002 <-- TextBaseEvent: output "a" (2 messages), {2 * size} bytes')
        self.assertRegex(lines[3], r"^   \+0\.000004 <-- IIPReply: ok, \d+ bytes$")
        self.assertEqual(lines[4], "request " + "0" * 31 + '7: eval "never"')
        self.assertEqual(lines[-1], "   no reply")

    def test_a_real_session(self):
        found = self.objects("--frames", file=self.real)
        types = [each["type"] for each in found[1:]]
        self.assertEqual(sorted(types[:8]), sorted(["hello", "verdict", "token", "answer"] * 2))
        begin = types.index("IIPEnqueueMessage")
        self.assertEqual(types[begin], "IIPEnqueueMessage")
        answer = next(each for each in found[1:] if each["type"] == "IIPReply")
        self.assertEqual(answer["request"], found[1:][begin]["request"])
        # The array is in shared memory or not; its bytes are recorded all the same.
        self.assertIn(2_400_000, [part["size"] for part in answer["frames"]])
        self.assertGreater(answer["size"], 2_400_000)
        self.assertEqual(self.inspect("--lint", file=self.real)[0].split(" units")[0].rpartition(" ")[0],
                         "no rule is broken in")

    def test_standard_input_and_every_beginning(self):
        whole = recorded((">", request()), ("<", text(1, b"a"))).bytes()
        self.write(whole)
        with open(self.file, "rb") as file:
            self.assertEqual(self.inspect(file="-", stdin=file)[0], self.inspect()[0])
        self.write(whole[:-5])
        out, err = self.inspect("--lint")
        self.assertEqual(err, f"krutil: the recording ends within a block, at byte {len(whole) - 5}\n")
        self.assertEqual(out, "no rule is broken in 6 units of 1 sessions\n")
        self.assertEqual(self.objects("--lint")[-1],
                         {"event": "unfinished", "text": err.removeprefix("krutil: ").rstrip()})

    def test_damage_and_what_is_no_recording(self):
        self.write(b"no recording at all")
        self.assertEqual(self.inspect(exit_code=2), (
            "", f"krutil: '{self.file}', byte 0: first bytes: expected 0a 0d 0d 0a, with which a file of the format "
            "pcapng begins, got 6e 6f 20 72\n"))
        failure = self.objects(exit_code=2)
        self.assertEqual((failure[0]["event"], failure[0]["exitCode"]), ("failure", 2))
        missing = os.path.join(self.directory, "none")
        self.assertEqual(self.inspect(file=missing, exit_code=2)[1],
                         f"krutil: cannot read '{missing}': No such file or directory\n")

    def finding(self, *units, exit_code=4, **features):
        """What --lint says of the last unit of a recording, and that it names its place."""
        recording = recorded(*units, **features)
        self.write(recording)
        offset = sum(len(block) for block in recording.blocks[:-1])
        prefix = f"'{self.file}', byte {offset}: "
        out = self.inspect("--lint", exit_code=exit_code)[0]
        self.assertTrue(out.startswith(prefix), out)
        self.assertEqual(self.objects("--lint", exit_code=exit_code)[-1],
                         {"event": "finding", "session": 0, "offset": offset, "text": out[len(prefix):].rstrip("\n")})
        return out[len(prefix):].rstrip("\n")

    def test_lint_finds_what_a_session_would_refuse(self):
        self.write(recorded((">", request()), ("<", text(1, b"a")), ("<", reply()), (">", GOODBYE), ("<", SHUTDOWN)))
        self.assertEqual(self.inspect("--lint")[0], "no rule is broken in 11 units of 1 sessions\n")
        self.assertEqual(self.finding(("<", reply())), 'message on stream 1: "krutil:IIPReply" is a reply: expected the '
                                                       "stream ID of an open exchange")
        self.assertEqual(self.finding((">", request()), ("<", reply()), ("<", text(1, b"late"))),
                         'message on stream 1: "krutil:TextBaseEvent" is an event: expected the stream ID 0 or that of '
                         "an open exchange")
        self.assertEqual(self.finding((">", GOODBYE), (">", request())), "expected nothing after the client's goodbye, "
                                                                         "got another frame")
        self.assertEqual(self.finding((">", request()), (">", request())),
                         'message on stream 1: "krutil:IIPEnqueueMessage" begins an exchange: expected a stream ID that '
                         "is not 0 and not in use")
        self.assertEqual(self.finding(("<", frame(9, 0, 0, 0, "", b""))),
                         "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 9")
        self.assertEqual(self.finding(("<", frame(1, 29, 0, 3, "krutil:TextBaseEvent", b""))),
                         "frame index: expected 1, got 3")
        self.assertEqual(self.finding((">", [request()[1].replace(b"\2\0\0\0\0\0\0\0", b"\1\0\0\0\0\0\0\0", 1)])),
                         'cannot read "krutil:IIPEnqueueMessage": frame 1: expected a frame, got none: it was read '
                         "already")
        self.assertEqual(self.finding(("<", frame(1, 29, 0, 1, "krutil:TextBaseEvent", field(2, 9)))),
                         'frame "krutil:TextBaseEvent", byte 0, field stream: expected a stream from 0 to 2, got 9')
        self.assertEqual(self.finding(("<", frame(1, 29, 0, 1, "krutil:TextBaseEvent", b"", size=5 << 20))),
                         'content of frame 1 with tag "krutil:TextBaseEvent" exceeds the limit "taggedFrame": expected '
                         "at most 4194304 bytes, got 5242880")

    def test_lint_finds_what_only_a_recording_can_have(self):
        self.assertEqual(self.finding(("<", text(1, b"cut")[:-1])), "size of frame 1 on stream 1: expected 25 bytes "
                                                                    "behind its header, got 24")
        self.assertEqual(self.finding(("<", text(1, b"cut")[:20])),
                         "size of a frame: expected at least 24 bytes, got 20")
        abort = frame(4, 0, 0, 0, "", b"why", last=False)
        self.assertEqual(self.finding(("<", abort), ("<", SHUTDOWN)), "frame behind an abort: expected none, got one "
                                                                      "more")
        self.assertEqual(self.finding((">", hello(0))),
                         "first message: expected one in each direction, got another one")

    def test_lint_knows_shared_memory(self):
        size = 1 << 20
        place = struct.pack("<QQQ", 7, 4096, size)
        array = [frame(5, 11, 1, 1, "", place, last=False) + bytes(size),
                 frame(1, 29, 1, 2, "krutil:QDA", field(1, 5) + field(2, varint(size // 8)) + field(3, 1) + field(5, 1),
                       last=False),
                 frame(1, 29, 1, 3, "krutil:FEvalIIP",
                       IIP + field(2, b"f") + field(3, 1) + field(4, varint(2)) + field(5, 1) + field(6, 1),
                       last=False),
                 frame(1, 27, 1, 4, "krutil:IIPEnqueueMessage", field(1, 3))]
        back = frame(6, 0, 0, 7, "", b"", last=False)
        self.write(recorded((">", array), ("<", back), shared=True))
        self.assertEqual(self.inspect("--lint")[0], "no rule is broken in 13 units of 1 sessions\n")
        self.assertIn("1 arguments, 1 outputs", self.inspect()[0])
        self.assertEqual(self.finding((">", array), ("<", back), ("<", back), shared=True),
                         "return frame: expected the number of a content that is lent, got 7")
        small = frame(5, 11, 1, 1, "", struct.pack("<QQQ", 7, 0, 9), last=False) + bytes(9)
        self.assertEqual(self.finding((">", small), shared=True),
                         "shared content of frame 1 on stream 1: expected 1048576 bytes or more, got 9")

    def test_signs_of_life(self):
        life = frame(7, 0, 0, 0, "", b"", last=False)
        self.write(recorded((">", [life, *request(), life]), ("<", [*reply(), life]), (">", [GOODBYE, life]),
                            ("<", SHUTDOWN), living=True))
        self.assertEqual(self.inspect("--lint")[0], "no rule is broken in 14 units of 1 sessions\n")
        self.assertEqual(self.inspect("--type", "keep-alive")[0].count(" keep-alive, 24 bytes\n"), 4)
        self.assertEqual(self.finding(("<", SHUTDOWN), ("<", life), living=True),
                         "expected nothing after the engine's shutdown event, got another frame")
        self.assertEqual(self.finding((">", life)),
                         "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 7")

    def test_lint_checks_the_handshake(self):
        def of(*units):
            recording = Recording("client 1")
            for direction, unit in units:
                recording.add(OUTBOUND if direction == ">" else INBOUND, unit)
            self.write(recording)
            return self.inspect("--lint", exit_code=4)[0].partition(": ")[2].rstrip("\n")
        self.assertEqual(of((">", b"HTTP/1.1")), 'first message: expected one that begins with "\\x89KRUTIL\\n", got '
                                                 '"HTTP/1.1"')
        self.assertEqual(of((">", hello(0)[:-1])),
                         f"length in a first message: expected the {len(hello(0)) - 17} bytes behind it, at most 65536, "
                         f"got {len(hello(0)) - 16}")
        self.assertEqual(of((">", hello(1))), "role in a first message: expected 0 (client), got 1")
        self.assertEqual(of((">", hello(0, layout=2))), "layout version of a first message: expected 1, got 2")
        self.assertEqual(of((">", hello(0)), (">", verdict())), "verdict: expected the first messages of both ends "
                                                                "before it, got fewer")
        begin = ((">", hello(0)), ("<", hello(1)), (">", verdict()))
        self.assertEqual(of(*begin, ("<", verdict(accepted=0)), (">", GOODBYE)),
                         "frame: expected two verdicts before it that accept, got one that refuses")
        self.assertEqual(of(*begin, ("<", verdict(shared=True)), (">", GOODBYE)),
                         "features of the verdicts: expected the same from both ends, got others")
        self.assertEqual(of(*begin, (">", GOODBYE)), "frame: expected the verdicts of both ends before it, got fewer")

    def test_lint_needs_whole_sessions(self):
        recording = recorded()
        recording.add(INBOUND, text(0, b"x" * 100), snap=60)
        self.write(recording)
        self.assertRegex(self.inspect("--lint", exit_code=2)[1],
                         r"^krutil: --lint needs all bytes, but the recording has only the first 60 of the \d+ of the "
                         r"frame at byte \d+; record without --record-snap\n$")
        self.assertEqual(self.inspect("--frames")[0].splitlines()[-1].partition(": ")[2],
                         "stream 0 frame 1 last type 29 krutil:TextBaseEvent, 102 bytes, 86 of them not recorded")


if __name__ == "__main__":
    unittest.main(argv=[sys.argv[0], *sys.argv[3:]])
