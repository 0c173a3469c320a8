"""Client or engine with system calls that go wrong, at each of their call sites in turn.

Whatever goes wrong: the programs end in time, by themselves, with one of their exit codes and not by a signal; nobody is
left behind; and either the output is whole or a sentence says what has happened.

    faults_test.py PROGRAM KRUTIL KRUTIL-QVM LIBRARY

PROGRAM, krutil or krutil-qvm, is the one whose calls go wrong. LIBRARY makes them go wrong (Faults.cpp).
"""

import concurrent.futures
import os
import pathlib
import re
import subprocess
import sys
import tempfile
import unittest

import numpy

from errors_of_calls import rules
from eventually import eventually
from processes import adopt_orphans, all_have_ended

PROGRAM, CLIENT, ENGINE, LIBRARY = sys.argv[1:5]

# Longer than any time limit of the programs.
PATIENCE = 60

# Output in many pieces, by Python and past it, and a value.
CODE = """\
import os
for i in range(20): print("line", i)
b = os.write(1, b"past Python\\n")
6 * 7
"""
OUTPUT = "".join(f"line {i}\n" for i in range(20)) + "past Python\n42\n"

MANY_LINES = 'for i in range(5000): print("long " * 20)'

# Where these failed for ever, no program could work.
WAITING = ("poll@", "ppoll@", "epoll_wait@", "read@")


class Session:
    """One run of the client with an engine, in a directory of its own."""

    #: What it leaves there at most.
    FILES = {"client.pcapng", "engine.pcapng", "trace", "diary", "log"}

    def __init__(self, rule: str, code: str = CODE) -> None:
        with tempfile.TemporaryDirectory() as directory:
            path = pathlib.Path(directory)
            command = self.command(path, code)
            environment = dict(os.environ, LD_PRELOAD=LIBRARY, KRUTIL_FAULTS=f"{PROGRAM} {rule}")
            try:
                ended = subprocess.run(command, stdin=subprocess.DEVNULL, capture_output=True, env=environment, text=True,
                                       errors="backslashreplace", timeout=PATIENCE)
            except subprocess.TimeoutExpired as expired:
                self.code, self.output, self.errors = None, str(expired.stdout), str(expired.stderr)
            else:
                self.code, self.output, self.errors = ended.returncode, ended.stdout, ended.stderr
            self.files = sorted(os.listdir(directory))
            self.look(path)

    def command(self, path: pathlib.Path, code: str) -> list:
        return [CLIENT, "eval", "--record", path / "client.pcapng", "--trace-to", path / "trace", "--diary", "--log",
                "--engine", f"{ENGINE} --stdio --isolated --diary {path}/diary --log {path}/log "
                            f"--record {path}/engine.pcapng", code]

    def look(self, path: pathlib.Path) -> None:
        """At what it has left."""

    def is_whole(self) -> bool:
        # What comes past Python has no place in what Python prints.
        return sorted(self.output.splitlines()) == sorted(OUTPUT.splitlines())

    def fault(self) -> str:
        """What is wrong with how it went; empty for nothing."""
        if self.code is None:
            return f"did not end within {PATIENCE} s"
        if not 0 <= self.code <= 6:
            return f"ended with {self.code}"
        lines = self.errors.splitlines()
        if any(not re.match(r"krutil(-qvm)?: .|\s|Traceback|OSError|BlockingIOError|EOFError", line) for line in lines):
            return "said something that is no sentence"
        if not self.is_whole() and not lines:
            return "lost output without a word"
        if not self.is_whole() and self.code == 0:
            return "lost output and ended with 0"
        if not set(self.files) <= self.FILES:
            return f"left {self.files}"
        return ""

    def __str__(self) -> str:
        return f"exit code {self.code}\n--- output\n{self.output}\n--- errors\n{self.errors}"


class Call(Session):
    """A call with a large array, which both ends see in shared memory, and as large results in files."""

    ELEMENTS = numpy.arange(300_000) / 8
    FILES = {"argument.npy", "fractions.npy", "integers.npy"}

    def command(self, path: pathlib.Path, code: str) -> list:
        numpy.save(path / "argument.npy", self.ELEMENTS)
        return [CLIENT, "call", "--nout", "2", "--output", path / "fractions.npy", "--output", path / "integers.npy",
                "--engine", f"{ENGINE} --stdio --isolated", "numpy.modf", path / "argument.npy"]

    def look(self, path: pathlib.Path) -> None:
        self.cut = []
        for name, expected in zip(("fractions.npy", "integers.npy"), numpy.modf(self.ELEMENTS)):
            try:
                results = numpy.load(path / name)
            except FileNotFoundError:
                continue
            except ValueError:
                results = None
            if not numpy.array_equal(results, expected):
                self.cut.append(name)

    def is_whole(self) -> bool:
        return self.FILES <= set(self.files)

    def fault(self) -> str:
        return super().fault() or (f"left {self.cut}, which are not whole" if self.cut else "")


class FaultsTest(unittest.TestCase):
    def test_bytes_one_at_a_time_change_nothing(self):
        session = Session("short")
        self.assertEqual((session.code, session.output, session.errors), (0, OUTPUT, ""))

    def test_interrupted_calls_change_nothing(self):
        session = Session("interrupted")
        self.assertEqual((session.code, session.output, session.errors), (0, OUTPUT, ""))

    def test_streams_that_are_full_change_nothing(self):
        session = Session("narrow", MANY_LINES)
        self.assertEqual((session.code, session.output, session.errors), (0, ("long " * 20 + "\n") * 5000, ""))

    def expect_each_call_site_may_fail(self, kind):
        with tempfile.NamedTemporaryFile("r") as listed:
            session = kind(f"list {listed.name}")
            self.assertEqual((session.code, session.fault(), session.errors), (0, "", ""), str(session))
            sites = sorted(set(listed.read().split()))
        self.assertGreater(len(sites), 20)
        tried = rules(sites, WAITING)
        with concurrent.futures.ThreadPoolExecutor(len(os.sched_getaffinity(0))) as workers:
            faults = [f"{rule}: {session.fault()}\n{session}" for rule, session in zip(tried, workers.map(kind, tried))
                      if session.fault()]
        self.assertEqual(faults, [], "\n\n".join(faults))
        eventually(all_have_ended, "the end of each process")

    def test_each_call_site_of_an_evaluation_may_fail(self):
        self.expect_each_call_site_may_fail(Session)

    def test_each_call_site_of_a_call_may_fail(self):
        self.expect_each_call_site_may_fail(Call)


if __name__ == "__main__":
    adopt_orphans()
    unittest.main(argv=sys.argv[:1])
