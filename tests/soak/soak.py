"""Sessions over every transport that do everything at once, for as long as wanted. Everything carries a number, so that
nothing can be lost, doubled or reordered without being seen. Memory, descriptors and threads of all processes are
watched: they must not grow. That is judged when it lasts a minute or longer.

    soak.py MINUTES [SEED]

krutil and krutil-qvm are found in the PATH. Ends with status 1 when anything is wrong; what is wrong is told.
"""

import os
import random
import signal
import subprocess
import sys
import tempfile
import threading
import time
import traceback

import krutil
import numpy
from eventually import PATIENCE
from processes import Listener, growth, usage

RELAY = os.path.join(os.path.dirname(os.path.abspath(__file__)), "relay.py")
SETUP = r"""
import os, threading, time, warnings
class Picture:
    def __init__(self, number): self.number = number
    def __repr__(self): return f"picture {self.number}"
    def _repr_png_(self): return PNG + b"%d" % self.number
PNG = b"\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0\1\0\0\0\1"
"""


class Wrong(Exception):
    """Something that must not be."""


def expect(what, expected, got):
    if got != expected:
        raise Wrong(f"{what}: expected {str(expected)[:200]}, got {str(got)[:200]}")


class Soak:
    def __init__(self, seconds, seed):
        self.deadline = time.monotonic() + seconds
        self.seed = seed
        self.lock = threading.Lock()
        self.done = {}     # operations by name
        self.wrong = []
        self.watched = {}  # what a process is -> its pid
        self.samples = {}  # what a process is -> [Usage]

    def going_on(self):
        return time.monotonic() < self.deadline and not self.wrong

    def count(self, operation, times=1):
        with self.lock:
            self.done[operation] = self.done.get(operation, 0) + times

    def watch(self, what, pid):
        with self.lock:
            self.watched[what] = pid

    def sample(self):
        with self.lock:
            watched = dict(self.watched)
        for what, pid in watched.items():
            used = usage(pid)
            if used is not None:
                self.samples.setdefault(what, []).append(used)

    def fail(self, where):
        with self.lock:
            self.wrong.append(f"{where}:\n{traceback.format_exc()}")


class Talker:
    """One session that does all that a session can do, in an order of its own."""

    def __init__(self, soak, name, open_session):
        self.soak = soak
        self.name = name
        self.random = random.Random(f"{soak.seed} {name}")
        self.open_session = open_session
        self.number = 0
        self.answers = 0

    def run(self):
        try:
            with self.open_session(on_input=self.answer, on_display=lambda display: None) as session:
                session.eval(SETUP)
                self.soak.watch(f"{self.name}: session", int(session.eval("os.getpid()").value))
                operations = [self.text, self.call, self.error, self.cancel, self.prompt, self.warning, self.picture,
                              self.burst, self.mixture]
                while self.soak.going_on():
                    operation = self.random.choice(operations)
                    operation(session)
                    self.soak.count(operation.__name__)
        except Exception:
            self.soak.fail(self.name)

    def next(self, count=1):
        self.number += count
        return self.number - count

    def answer(self, prompt):
        self.answers += 1
        return str(prompt).rstrip("? ")

    def text(self, session):
        count = self.random.choice([1, 10, 3000])
        begin = self.next(count)
        heard = []
        result = session.eval(f"for n in range({begin}, {begin + count}): print(n)", on_text=heard.append)
        expected = "".join(f"{n}\n" for n in range(begin, begin + count))
        expect("output", expected, result.output)
        expect("text as it came", expected, "".join(heard))

    def call(self, session):
        elements = self.random.choice([1, 1000, 200_000, 1_000_000])
        number = self.next()
        argument = krutil.empty(elements) if self.random.random() < 0.5 else numpy.empty(elements)
        argument[:] = numpy.arange(elements)
        expect("sum", True, numpy.array_equal(session.call("numpy.add", argument, number), argument + number))

    def error(self, session):
        number = self.next()
        try:
            session.eval(f"def f(): raise ValueError({number})\nf()")
        except krutil.RemoteError as error:
            expect("error", ("ValueError", str(number)), (error.identifier, error.message))
            expect("function of the last frame", "f", error.frames[-1].function)
            return
        raise Wrong("an error did not arrive")

    def cancel(self, session):
        endless = session.submit("while True: time.sleep(0.001)")
        after = session.submit(f"{self.next()}")
        waits = session.submit("'never'")
        for event in endless.events():
            if event == "started":
                break
        expect("answer to a cancel of what waits", krutil.CancelAnswer.CANCELLED, waits.cancel())
        expect("answer to a cancel of what runs", krutil.CancelAnswer.PENDING, endless.cancel())
        for request in endless, waits:
            try:
                request.result(timeout=PATIENCE)
            except krutil.Cancelled:
                continue
            raise Wrong("a cancelled request has a result")
        expect("value", str(self.number - 1), after.result(timeout=PATIENCE).value)

    def prompt(self, session):
        number = self.next()
        before = self.answers
        expect("line", f"'{number}'", session.eval(f"input('{number}? ')").value)
        expect("number of prompts", before + 1, self.answers)

    def warning(self, session):
        number = self.next()
        result = session.eval(f"warnings.simplefilter('always')\nwarnings.warn('number {number}')")
        expect("warnings", [f"number {number}"], [warning.message for warning in result.warnings])

    def picture(self, session):
        number = self.next()
        display, = session.eval(f"Picture({number})").displays
        expect("picture", b"\0\0\0\1%d" % number, bytes(display.formats["image/png"])[20:])

    def burst(self, session):
        count = self.random.choice([10, 200])
        begin = self.next(count)
        requests = [session.submit(f"print({n}); {n}") for n in range(begin, begin + count)]
        for n, request in zip(range(begin, begin + count), requests):
            result = request.result(timeout=PATIENCE)
            expect("output and value", (f"{n}\n", str(n)), (result.output, result.value))

    def mixture(self, session):
        number = self.next()
        argument = numpy.full(300_000, float(number))
        code = session.submit(f"for n in range(1000): print({number}, n)\n{number}")
        call = session.submit_call("numpy.negative", argument)
        expect("value", str(number), code.result(timeout=PATIENCE).value)
        expect("output", "".join(f"{number} {n}\n" for n in range(1000)), code.output)
        expect("array", True, numpy.array_equal(call.result(timeout=PATIENCE), -argument))


class Visitors:
    """Sessions that come and go at one listener: clients that read slowly, that are stopped for a while, that are
    killed, that run short code."""

    def __init__(self, soak, path):
        self.soak = soak
        self.path = path
        self.random = random.Random(f"{soak.seed} visitors")

    def run(self):
        try:
            while self.soak.going_on():
                visit = self.random.choice([self.slow, self.stopped, self.killed, self.short])
                visit()
                self.soak.count(visit.__name__)
        except Exception:
            self.soak.fail("visitors")

    def client(self, code):
        return subprocess.Popen(["krutil", "eval", "--connect", self.path, code], stdin=subprocess.DEVNULL,
                                stdout=subprocess.PIPE, stderr=subprocess.PIPE)

    def expect_lines(self, client, count, read):
        lines = read(client.stdout)
        error = client.stderr.read()
        expect("exit code", 0, client.wait(PATIENCE))
        expect("standard error", b"", error)
        expect("lines", b"".join(b"%d\n" % n for n in range(count)), lines)
        client.stdout.close()
        client.stderr.close()

    def slow(self):
        def read(stream):
            pieces = []
            while piece := stream.read(20_000):
                pieces.append(piece)
                time.sleep(0.002)
            return b"".join(pieces)
        self.expect_lines(self.client("for n in range(100_000): print(n)"), 100_000, read)

    def stopped(self):
        client = self.client("for n in range(100_000): print(n)")

        def read(stream):
            first = stream.read(1)
            client.send_signal(signal.SIGSTOP)
            time.sleep(0.2)
            client.send_signal(signal.SIGCONT)
            return first + stream.read()
        self.expect_lines(client, 100_000, read)

    def killed(self):
        client = self.client("while True: print('again')")
        client.stdout.read(self.random.choice([1, 10_000]))
        client.kill()
        expect("exit code", -signal.SIGKILL, client.wait(PATIENCE))
        client.stdout.close()
        client.stderr.close()

    def short(self):
        self.expect_lines(self.client("print(0)"), 1, lambda stream: stream.read())


def stop(listener):
    """All of its sessions have ended with their clients. It may have said of some that they were killed."""
    expect("exit code of a listener", 0, listener.stop())
    expect("words of a listener", [], [line for line in listener.said()[1:] if "the stream ended" not in line])


def report(soak, seconds):
    print(f"{sum(soak.done.values())} operations in {seconds:.0f} s: "
          + ", ".join(f"{count} {name}" for name, count in sorted(soak.done.items())))
    for what, samples in sorted(soak.samples.items()):
        if seconds < 60 or len(samples) < 9:
            continue
        grown, last = growth(samples), samples[-1]
        print(f"{what}: {last.memory // 1024} MiB, {last.descriptors} descriptors, {last.threads} threads; "
              f"more than before: {grown.memory} KiB, {grown.descriptors}, {grown.threads}")
        # Kept memory depends on what was asked for last, up to the 256 MiB that a process keeps.
        if grown.memory > 16_384 + samples[len(samples) // 3].memory // 5:
            soak.wrong.append(f"{what}: its memory grows")
        if grown.descriptors > 2 or grown.threads > 2:
            soak.wrong.append(f"{what}: its descriptors or threads grow")
    for text in soak.wrong:
        print(f"WRONG: {text}")


def main():
    minutes = float(sys.argv[1])
    seed = sys.argv[2] if len(sys.argv) > 2 else str(random.SystemRandom().randrange(10**6))
    print(f"{minutes} minutes, seed {seed}", flush=True)
    begin = time.monotonic()
    soak = Soak(60 * minutes, seed)
    soak.watch("client", os.getpid())
    with tempfile.TemporaryDirectory() as directory:
        listeners = {"shared memory": Listener(directory, "shared"),
                     "socket": Listener(directory, "bytes", "--no-shared-memory"),
                     "visited": Listener(directory, "visited")}
        for name, listener in listeners.items():
            soak.watch(f"{name}: listener", listener.process.pid)
        talkers = [
            Talker(soak, f"{name} {n}", lambda path=listeners[name].path, **options: krutil.connect(path, **options))
            for name in ("shared memory", "socket") for n in (1, 2)]
        talkers.append(Talker(soak, "pipes", lambda **options: krutil.start("krutil-qvm --stdio", **options)))
        relay = [sys.executable, "-B", RELAY, listeners["socket"].path]
        talkers.append(Talker(soak, "relay", lambda **options: krutil.start(relay, **options)))
        threads = [threading.Thread(target=each.run) for each in (*talkers, Visitors(soak, listeners["visited"].path))]
        for thread in threads:
            thread.start()
        while any(thread.is_alive() for thread in threads):
            soak.sample()
            threads[0].join(min(5.0, 1.0 * minutes))
            time.sleep(0.05)
        for name, listener in listeners.items():
            try:
                stop(listener)
            except Exception:
                soak.fail(f"{name}: listener")
    report(soak, time.monotonic() - begin)
    return 1 if soak.wrong else 0


if __name__ == "__main__":
    sys.exit(main())
