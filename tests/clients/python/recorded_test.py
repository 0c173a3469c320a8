"""Sessions that were recorded once, played again without an engine.

    recorded_test.py                      plays the recordings
    recorded_test.py --record             makes them anew; the directory of krutil-qvm is the first in PATH

A recording lists in order what each end said: messages of the client by root and stream ID, those of the engine byte by
byte. So it shows that a client of today understands an engine of the day of the recording.
"""

import os
import socket
import struct
import subprocess
import sys
import threading
import unittest

import krutil
import numpy
from krutil import wire
from engine_test import joined, set_zero_copy
from eventually import PATIENCE
from scripted import ScriptedEngine

DIRECTORY = os.path.join(os.path.dirname(os.path.abspath(__file__)), "recorded")
BYTES_IN_A_LINE = 48


class Sessions:
    """What the recordings hold: each method is a session."""

    options = {
        "prompts": {"on_input": lambda text: {"name? ": "Ada"}.get(text),
                    "on_debug": lambda prompt: prompt.eval("x = x + 1")},
    }

    def evaluation(self, session):
        texts = []
        result = session.eval("print('zwölf'); import sys; print('two', file=sys.stderr); [1, 2]", timeout=PATIENCE,
                              on_text=lambda text: texts.append((str(text), text.stream)))
        self.assertEqual(result, krutil.Result("zwölf\ntwo\n", "[1, 2]", ()))
        self.assertEqual(joined(texts), [("zwölf\n", "output"), ("two\n", "error")])
        warned, = session.eval("import warnings; warnings.warn('careful')", timeout=PATIENCE).warnings
        self.assertEqual(warned, ("UserWarning", "careful", (("<eval-2>", "<module>", 1),)))

    def error(self, session):
        code = "def f():\n    1 / 0\ntry:\n    f()\nexcept ZeroDivisionError as e:\n    raise ValueError('no') from e"
        with self.assertRaises(krutil.RemoteError) as caught:
            session.eval(code, timeout=PATIENCE)
        self.assertEqual((caught.exception.identifier, caught.exception.message), ("ValueError", "no"))
        cause, = caught.exception.causes
        self.assertEqual(cause.frames, (("<eval-1>", "<module>", 4), ("<eval-1>", "f", 2)))

    def call(self, session):
        sent = numpy.arange(256.0).reshape(2, 128)
        first, second = session.call("numpy.array_split", sent, 2, outputs=2, timeout=PATIENCE)
        self.assertEqual((first.tolist(), second.tolist()), (sent[:1].tolist(), sent[1:].tolist()))
        # Large enough for a frame of its own.
        received = session.call("numpy.negative", sent, timeout=PATIENCE)
        self.assertTrue(numpy.array_equal(received, -sent))
        self.assertEqual(session.call("str.upper", "zwölf", timeout=PATIENCE), "ZWÖLF")

    def cancel(self, session):
        endless = session.submit("while True: pass")
        for event in endless.events(PATIENCE):
            if event == "started":
                waiting = session.submit("1")
                self.assertEqual(waiting.cancel(timeout=PATIENCE), krutil.CancelAnswer.CANCELLED)
                self.assertEqual(endless.cancel(timeout=PATIENCE), krutil.CancelAnswer.PENDING)
        for request in (endless, waiting):
            with self.assertRaises(krutil.Cancelled):
                request.result(PATIENCE)

    def prompts(self, session):
        self.assertEqual(session.eval("input('name? ')", timeout=PATIENCE).value, "'Ada'")
        code = "def f(x):\n    breakpoint()\n    return x\nf(41)"
        self.assertEqual(session.eval(code, timeout=PATIENCE).value, "42")


NAMES = ["evaluation", "error", "call", "cancel", "prompts"]


class RecordedSessionsTest(Sessions, unittest.TestCase):
    def setUp(self):
        set_zero_copy(self, True)

    def play(self, name):
        engine = ScriptedEngine(lambda engine: play(engine, name))
        options = self.options.get(name, {})
        with krutil.Session(engine.connection, timeout=PATIENCE, **options) as session:
            getattr(self, name)(session)
        engine.join()


for each in NAMES:
    setattr(RecordedSessionsTest, f"test_{each}", lambda self, name=each: self.play(name))


def play(engine, name):
    """The engine of a recording."""
    with open(os.path.join(DIRECTORY, f"{name}.txt"), encoding="utf-8") as file:
        lines = [line for line in file.read().splitlines() if not line.startswith("#")]
    for number, line in enumerate(lines):
        if line.startswith("engine"):
            data = ""
            for more in lines[number + 1:]:
                if not more.startswith(" "):
                    break
                data += more
            engine.send(bytes.fromhex(data))
        elif line.startswith("client"):
            said = "client: " + next_of_client(engine._reader)
            if said != line:
                raise AssertionError(f"{name}: expected '{line}', got '{said}'")


def next_of_client(reader):
    """What the client says next, in words; `greeted` of its reader tells what has come before."""
    greeted = getattr(reader, "greeted", 0)
    reader.greeted = greeted + 1
    if greeted == 0:
        reader.read(12, "magic and layout")
    if greeted < 2:
        reader.read(struct.unpack("<I", reader.read(4, "length"))[0], "body")
        return ("first message", "verdict")[greeted]
    try:
        message = wire.read_message(reader, krutil.Limits())
    except wire.Violation as violation:
        assert str(violation) == "goodbye frame: expected one from clients only, got one from the engine"
        return "goodbye"
    return f"{message.root} on stream {message.stream}" if message else "the end"


class Tap(wire.Reader):
    """Keeps what is read."""

    def __init__(self, connection):
        super().__init__(connection)
        self.taken = b""

    def read(self, size, what):
        data = super().read(size, what)
        self.taken += bytes(data)
        return data


def record(name):
    """Runs a session with the real engine, and writes down what is said."""
    client, near = socket.socketpair()
    far, theirs = socket.socketpair()
    engine = subprocess.Popen(["krutil-qvm", "--stdio"], stdin=theirs, stdout=theirs)
    theirs.close()
    lock, said = threading.Lock(), []

    def relay(source, target, who):
        tap = Tap(source)
        words = ""
        while words not in ("goodbye", "the end"):
            words = next_of_client(tap)
            data, tap.taken = tap.taken, b""
            with lock:
                said.append((who, words, data))
                target.sendall(data)
        target.shutdown(socket.SHUT_WR)

    threads = [threading.Thread(target=relay, args=arguments)
               for arguments in ((near, far, "client"), (far, near, "engine"))]
    for thread in threads:
        thread.start()
    test = RecordedSessionsTest()
    with krutil.Session(client, timeout=PATIENCE, **test.options.get(name, {})) as session:
        getattr(test, name)(session)
    for thread in threads:
        thread.join()
    engine.wait()
    with open(os.path.join(DIRECTORY, f"{name}.txt"), "w", encoding="utf-8") as file:
        file.write("# Written by recorded_test.py --record; do not edit.\n")
        for who, words, data in said:
            if words == "the end":
                continue
            file.write(f"{who}: {words}\n")
            if who == "engine":
                for place in range(0, len(data), BYTES_IN_A_LINE):
                    file.write(f"  {data[place:place + BYTES_IN_A_LINE].hex()}\n")


if __name__ == "__main__":
    if sys.argv[1:] == ["--record"]:
        os.environ.pop("QX_DISABLE_ZEROCOPY", None)
        os.makedirs(DIRECTORY, exist_ok=True)
        for each in NAMES:
            record(each)
    else:
        unittest.main()
