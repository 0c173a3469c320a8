"""The dissector for Wireshark, with the real tshark and capinfos: on files of bytes that a test gives, and on recordings of
real sessions."""

import json
import os
import struct
import subprocess
import tempfile
import unittest

import recordings
from recordings import INBOUND, OUTBOUND, Recording

# First message of a client and of an engine, with nothing but role and protocol, and a verdict that accepts.
MAGIC = b"\x89KRUTIL\n"


def first_message(role):
    body = (b"\x08\x01" if role == "engine" else b"") + b"\x12\x06krutil"
    return MAGIC + struct.pack("<II", 1, len(body)) + body


VERDICT = struct.pack("<I", 2) + b"\x08\x01"


def frame(kind, frame_type, stream, index, tag, content, last=True):
    return struct.pack("<BBHIQQ", kind | (0x80 if last else 0), frame_type, len(tag), stream, index,
                       len(content)) + tag.encode() + content


def handshake(recording):
    recording.add(OUTBOUND, first_message("client"))
    recording.add(INBOUND, first_message("engine"))
    recording.add(OUTBOUND, VERDICT)
    recording.add(INBOUND, VERDICT)


def manifest():
    with open(os.path.join(recordings.ROOT, "conformance", "manifest.json"), encoding="utf-8") as file:
        return json.load(file)["vectors"]


def write_array(path, elements):
    """A .npy file of so many doubles."""
    header = f"{{'descr': '<f8', 'fortran_order': False, 'shape': ({elements},), }}"
    header += " " * (-(len(header) + 11) % 64) + "\n"
    with open(path, "wb") as file:
        file.write(b"\x93NUMPY\1\0" + struct.pack("<H", len(header)) + header.encode() + bytes(8 * elements))


class DissectorTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        cls.environment = recordings.install(directory.name)
        cls.file = os.path.join(directory.name, "recording.pcapng")

    def run_tool(self, *command, status=0):
        done = subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True,
                              env=self.environment, check=False)
        self.assertEqual(done.returncode, status, done.stderr)
        return done.stdout, done.stderr

    def write(self, data):
        with open(self.file, "wb") as file:
            file.write(data)

    def fields(self, *names, status=0):
        """A list of values for each packet, without any option that a person would not give."""
        command = ["tshark", "-r", self.file, "-T", "fields", "-E", "occurrence=a"]
        for name in names:
            command += ["-e", name]
        lines = self.run_tool(*command, status=status)[0].splitlines()
        return [tuple(line.split("\t")) for line in lines]

    def test_a_session(self):
        recording = Recording()
        handshake(recording)
        recording.add(OUTBOUND, bytes(range(8)))
        recording.add(INBOUND, bytes(range(8, 16)))
        recording.add(OUTBOUND, b"\1")
        recording.add(INBOUND, b"\0")
        recording.add(OUTBOUND, frame(1, 29, 1, 1, "krutil:EvalIIP", b"\x12\x07print()", last=False))
        recording.add(OUTBOUND, frame(1, 27, 1, 2, "krutil:IIPEnqueueMessage", b"\x08\x01\x28\x03"))
        recording.add(INBOUND, frame(2, 4, 1, 1, "", b"data", last=False))
        recording.add(INBOUND, frame(5, 4, 1, 2, "", struct.pack("<QQQ", 7, 4096, 5), last=False) + b"hello")
        recording.add(INBOUND, frame(6, 1, 0, 9, "", b""))
        recording.add(OUTBOUND, frame(7, 0, 0, 0, "", b""))
        recording.add(OUTBOUND, frame(3, 0, 0, 0, "", b""))
        recording.add(INBOUND, frame(4, 0, 0, 0, "", b"why"))
        self.write(recording.bytes())
        self.assertEqual([line.split("krutil", 1)[1].split(" ", 2)[2] for line in self.summary()], [
            "client: hello", "engine: hello", "client: verdict", "engine: verdict", "client: token", "engine: token",
            "client: answer 1", "engine: answer 0", "client: stream 1 1 krutil:EvalIIP",
            "client: stream 1 2. krutil:IIPEnqueueMessage", "engine: stream 1 1 data, 4 bytes",
            "engine: stream 1 2 shared data, 5 bytes", "engine: stream 0. return", "client: stream 0. keep-alive",
            "client: stream 0. goodbye", "engine: stream 0. abort: why"])
        self.assertEqual(self.fields("krutil.sender", "krutil.kind", "krutil.last", "krutil.type", "krutil.stream",
                                     "krutil.index", "krutil.size", "krutil.tag")[8:], [
            ("client", "1", "0", "29", "1", "1", "9", "krutil:EvalIIP"),
            ("client", "1", "1", "27", "1", "2", "4", "krutil:IIPEnqueueMessage"),
            ("engine", "2", "0", "4", "1", "1", "4", ""),
            ("engine", "5", "0", "4", "1", "2", "24", ""),
            ("engine", "6", "1", "1", "0", "9", "0", ""),
            ("client", "7", "1", "0", "0", "0", "0", ""),
            ("client", "3", "1", "0", "0", "0", "0", ""),
            ("engine", "4", "1", "0", "0", "0", "3", "")])
        self.assertEqual(self.fields("krutil.shared.number", "krutil.shared.offset", "krutil.shared.size",
                                     "krutil.data")[11], ("7", "4096", "5", "68656c6c6f"))
        self.assertEqual(self.fields("krutil.token", "krutil.answer")[4:8], [
            ("0x0706050403020100", ""), ("0x0f0e0d0c0b0a0908", ""), ("", "1"), ("", "0")])
        text = self.run_tool("tshark", "-r", self.file, "-V", "-Y", "frame.number == 10")[0]
        self.assertIn("Message: krutil.protobuf.IIPEnqueueMessage", text)
        self.assertIn("Field(5): dequeueMode = DEQUEUE_AT_PROMPT(3) (enum)", text)
        text = self.run_tool("tshark", "-r", self.file, "-V", "-Y", "frame.number == 2")[0]
        self.assertIn("Field(1): role = ENGINE(1) (enum)", text)
        self.assertIn("Field(2): protocol = krutil (string)", text)

    def summary(self):
        return self.run_tool("tshark", "-r", self.file)[0].splitlines()

    def test_the_message_of_each_tag(self):
        recording = Recording()
        handshake(recording)
        expected = []
        for vector in manifest():
            if vector["well_formed"] and vector["name"] in ("typical", "default") and vector["frames"][-1]["size"] > 0:
                last = vector["frames"][-1]
                with open(os.path.join(recordings.ROOT, "conformance", vector["bytes"]), "rb") as file:
                    content = file.read()[last["offset"]:]
                recording.add(INBOUND, frame(1, last["frame_type"], 7, last["index"], last["tag"], content))
                expected.append((last["tag"], last["message"], ""))
        self.write(recording.bytes())
        self.assertEqual(len({tag for tag, *_ in expected}), 24)  # all but the one whose content is empty
        found = self.fields("krutil.tag", "protobuf.message.name", "_ws.malformed")[4:]
        self.assertEqual([(tag, names.split(",")[0], malformed) for tag, names, malformed in found], expected)

    def test_a_large_frame(self):
        recording = Recording()
        handshake(recording)
        text = b"x" * 600_000
        unit = frame(1, 29, 1, 1, "krutil:TextBaseEvent", b"\x1a\xc0\xcf\x24" + text)
        recording.add(INBOUND, unit)
        recording.add(INBOUND, frame(2, 4, 1, 1, "", text, last=False))
        recording.add(INBOUND, frame(3, 0, 0, 0, "", b""))
        self.write(recording.bytes())
        size = len(unit)
        self.assertEqual(self.fields("krutil.part", "krutil.tag", "krutil.size", "krutil.kind")[4:], [
            (f"bytes 0-262127 of {size}", "krutil:TextBaseEvent", "600004", "1"),
            (f"bytes 262128-524255 of {size}", "", "", ""),
            (f"bytes 524256-{size - 1} of {size}", "krutil:TextBaseEvent", "600004", "1"),
            ("bytes 0-262127 of 600024", "", "600000", "2"),
            ("bytes 262128-524255 of 600024", "", "", ""),
            ("bytes 524256-600023 of 600024", "", "", ""),
            ("", "", "0", "3")])
        self.assertEqual([name for name, in self.fields("protobuf.message.name")[4:7]],
                         ["", "", "krutil.protobuf.TextBaseEvent"])
        self.assertIn("Number of packets:   11", self.run_tool("capinfos", "-M", self.file)[0])

    def test_a_snapped_file(self):
        recording = Recording()
        handshake(recording)
        recording.add(INBOUND, frame(1, 29, 1, 1, "krutil:TextBaseEvent", b"\x1a\x64" + b"x" * 100), snap=60)
        recording.add(INBOUND, frame(3, 0, 0, 0, "", b""))
        self.write(recording.bytes())
        self.assertEqual(self.fields("krutil.part", "krutil.missing", "krutil.tag", "krutil.kind", "_ws.malformed")[4:], [
            ("bytes 0-59 of 146", "86", "krutil:TextBaseEvent", "1", ""), ("", "", "", "3", "")])

    def test_a_missing_part(self):
        recording = Recording()
        handshake(recording)
        recording.add(INBOUND, frame(2, 4, 1, 1, "", bytes(600_000)))
        del recording.blocks[-2]
        recording.add(INBOUND, frame(3, 0, 0, 0, "", b""))
        self.write(recording.bytes())
        self.assertEqual([bool(gap) for gap, in self.fields("krutil.gap")[4:]], [False, True, False])

    def test_a_damaged_file(self):
        recording = Recording()
        handshake(recording)
        recording.add(INBOUND, frame(1, 29, 1, 1, "krutil:TextBaseEvent", b"\x1a\x7f" + b"x"))
        recording.add(INBOUND, b"\x81\x1d")
        recording.add(INBOUND, frame(1, 29, 1, 1, "krutil:TextBaseEvent", b"")[:30])
        recording.add(INBOUND, frame(77, 0, 0, 0, "", b""))
        self.write(recording.bytes()[:-10])
        # What is left of the last packet is none; tshark says so, and shows the others.
        found = self.fields("krutil.kind", "krutil.short", status=2)[4:]
        self.assertEqual([(kind, bool(short)) for kind, short in found], [("1", False), ("", True), ("1", False)])
        self.write(recording.bytes())
        self.assertEqual([bool(each) for each, in self.fields("krutil.unknown")[4:]], [False, False, False, True])

    def record(self, *arguments):
        """Records a real session, which the client makes."""
        subprocess.run(["krutil", "call", "--record", self.file, *arguments], check=True, stdin=subprocess.DEVNULL,
                       stdout=subprocess.DEVNULL)

    def check_real(self, expected):
        """A call with arrays of 1,600,000 bytes, each of which spans packets: the sender and kind of their frames."""
        content = 1_600_000
        packets = self.fields("krutil.sender", "krutil.unit", "krutil.kind", "krutil.size", "krutil.shared.size",
                              "krutil.part", "krutil.gap", "krutil.short", "krutil.unknown", "_ws.malformed")
        self.assertEqual({packet[6:] for packet in packets}, {("", "", "", "")})
        large = [packet for packet in packets if str(content) in packet[3:5]]
        self.assertEqual([(packet[0], packet[2]) for packet in large], expected)
        for sender, kind in expected:
            unit = content + (48 if kind == "5" else 24)
            parts = [packet[5] for packet in packets if packet[0] == sender and packet[5].endswith(f" of {unit}")]
            self.assertEqual(parts, [f"bytes {first}-{min(first + 262_128, unit) - 1} of {unit}"
                                     for first in range(0, unit, 262_128)])
        names = [name.split(",")[0] for name, in self.fields("protobuf.message.name") if name]
        for name in ("msg_svc.protobuf.SessionHello", "msg_svc.protobuf.SessionVerdict", "krutil.protobuf.FEvalIIP",
                     "foundation.korveldata.protobuf.KORVEL_Array", "krutil.protobuf.IIPEnqueueMessage",
                     "krutil.protobuf.IIPReply"):
            self.assertIn(name, names)
        self.assertRegex(self.run_tool("capinfos", "-c", "-E", self.file)[0],
                         rf"Wireshark Upper PDU[^\n]*\n(?:.*\n)*Number of packets: +{len(packets)}\n")
        inspected = subprocess.run(["krutil", "inspect", "--lint", self.file], stdout=subprocess.PIPE, text=True,
                                   check=True).stdout
        self.assertRegex(inspected, r"^no rule is broken in \d+ units of 1 sessions\n$")

    def test_real_sessions(self):
        array = os.path.join(self.environment["HOME"], "array.npy")
        write_array(array, 200_000)
        # The second one of two results of a size is in shared memory: the first one's was filled as it left.
        self.record("--nout", "2", "numpy.modf", array)
        self.check_real([("client", "2"), ("engine", "2"), ("engine", "5")])
        self.record("--no-shared-memory", "numpy.sum", array)
        self.check_real([("client", "2")])


if __name__ == "__main__":
    unittest.main()
