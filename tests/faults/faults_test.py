"""Client or engine with system calls that go wrong, at each of their call sites in turn.

Whatever goes wrong: the programs end in time, by themselves, with one of their exit codes and not by a signal; nobody is
left behind; and either the output is whole or a sentence says what has happened.

    faults_test.py PROGRAM KRUTIL KRUTIL-QVM LIBRARY

PROGRAM, krutil or krutil-qvm, is the one whose calls go wrong. LIBRARY makes them go wrong (Faults.cpp).
"""

import concurrent.futures
import contextlib
import os
import pathlib
import pty
import re
import select
import shutil
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
            environment = dict(os.environ, LD_PRELOAD=LIBRARY, KRUTIL_FAULTS=f"{PROGRAM} {rule}", XDG_STATE_HOME=directory)
            try:
                ended = self.run(command, environment)
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

    def run(self, command: list, environment: dict) -> subprocess.CompletedProcess:
        return subprocess.run(command, stdin=subprocess.DEVNULL, capture_output=True, env=environment, text=True,
                              errors="backslashreplace", timeout=PATIENCE)

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


class WithRecording(Session):
    """What is done with the recording of a session, and what it prints and writes when nothing goes wrong."""

    recording: pathlib.Path
    #: Lines that some of the faults bring about.
    SAID: set = set()
    OUTPUT = ""
    WRITES = None
    FILES = {"session.pcapng"}

    @classmethod
    def begin(cls, recording: pathlib.Path) -> None:
        cls.recording = recording
        whole = cls("nothing")
        if (whole.code, whole.errors) != (0, ""):
            raise AssertionError(str(whole))
        cls.OUTPUT, cls.WRITES = whole.output, whole.written

    def command(self, path: pathlib.Path, code: str) -> list:
        shutil.copy(self.recording, path / "session.pcapng")
        return [CLIENT, *self.words(path, path / "session.pcapng")]

    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        raise NotImplementedError

    def look(self, path: pathlib.Path) -> None:
        # A page names its recording.
        name = str(path).encode()
        self.written = (path / "written").read_bytes().replace(name, b"") if "written" in self.files else None

    def is_whole(self) -> bool:
        return self.output == self.OUTPUT and self.written == self.WRITES

    def fault(self) -> str:
        left = self.written not in (None, self.WRITES)
        return super().fault() or ("left a part of what it writes" if left else "")


class Inspection(WithRecording):
    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        return ["inspect", "--fields", recording]


class Page(WithRecording):
    FILES = {"session.pcapng", "written"}

    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        return ["inspect", "--html", path / "written", recording]


class Redaction(Page):
    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        return ["inspect", "--redact", path / "written", recording]


class Replay(WithRecording):
    SAID = {"krutil: no descriptor to write to the engine: Too many open files",
            "krutil: cannot write to the engine: No space left on device"}

    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        return ["replay", "--patience", "3", "--engine", f"{ENGINE} --stdio --isolated", recording]


class ServedReplay(WithRecording):
    """Calls go wrong at the end that plays the engine alone."""

    SAID = {"krutil: cannot write to the client: No space left on device"}

    def words(self, path: pathlib.Path, recording: pathlib.Path) -> list:
        return ["eval", "--engine", f'KRUTIL_FAULTS="$OF_REPLAY" exec {CLIENT} replay --patience 3 --serve {recording}', CODE]

    def run(self, command: list, environment: dict) -> subprocess.CompletedProcess:
        ended = super().run(command, dict(environment, OF_REPLAY=environment["KRUTIL_FAULTS"], KRUTIL_FAULTS=""))
        # How far the client has come is told in any case.
        ended.stderr = re.sub(r"(?m)^\d of 2 messages of the client as in the recording\n", "", ended.stderr)
        return ended


class Typed(Session):
    """The line editor at a terminal, with a history."""

    KEYS = "6 * 7\r", "print('after')\r", "\x04"
    FILES = {"krutil"}

    def command(self, path: pathlib.Path, code: str) -> list:
        return [CLIENT, "--color", "never", "--engine", f"{ENGINE} --stdio --isolated"]

    def run(self, command: list, environment: dict) -> subprocess.CompletedProcess:
        """Types the keys, each when the prompt is there again."""
        ours, theirs = pty.openpty()
        said = b""
        keys = list(self.KEYS)
        with tempfile.TemporaryFile() as errors:
            process = subprocess.Popen(command, stdin=theirs, stdout=theirs, stderr=errors, start_new_session=True,
                                       env=dict(environment, TERM="xterm"))
            os.close(theirs)
            with contextlib.closing(os.fdopen(ours, "r+b", buffering=0)) as terminal:
                seen = 0
                while select.select([terminal], [], [], PATIENCE)[0]:
                    try:
                        said += terminal.read(10_000)
                    except OSError:
                        break
                    if keys and said.find(b">>> ", seen) >= 0:
                        seen = len(said)
                        terminal.write(keys.pop(0).encode())
                else:
                    process.kill()
            code = process.wait()
            if code == -9:
                raise subprocess.TimeoutExpired(command, PATIENCE, said, os.pread(errors.fileno(), 10_000, 0))
            return subprocess.CompletedProcess(command, code, said.decode(errors="backslashreplace"),
                                               os.pread(errors.fileno(), 10_000, 0).decode(errors="backslashreplace"))

    def look(self, path: pathlib.Path) -> None:
        self.kept = sorted(os.listdir(path / "krutil")) if "krutil" in self.files else []

    def is_whole(self) -> bool:
        return "\n42\r\n" in self.output and "\nafter\r\n" in self.output

    def fault(self) -> str:
        return super().fault() or (f"left {self.kept}" if self.kept not in ([], ["history"]) else "")


OF_THE_CLIENT = unittest.skipUnless(PROGRAM == "krutil", "the engine does the same for each client")


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

    def expect_each_call_site_may_fail(self, kind, fewest=20):
        with tempfile.NamedTemporaryFile("r") as listed:
            session = kind(f"list {listed.name}")
            self.assertEqual((session.code, session.fault(), session.errors), (0, "", ""), str(session))
            sites = sorted(set(listed.read().split()))
        self.assertGreater(len(sites), fewest)
        tried = rules(sites, WAITING)
        with concurrent.futures.ThreadPoolExecutor(4 * len(os.sched_getaffinity(0))) as workers:
            sessions = list(workers.map(kind, tried))
        faults = [f"{rule}: {session.fault()}\n{session}" for rule, session in zip(tried, sessions) if session.fault()]
        self.assertEqual(faults, [], "\n\n".join(faults))
        eventually(all_have_ended, "the end of each process")
        return {line for session in sessions for line in session.errors.splitlines()}

    def test_each_call_site_of_an_evaluation_may_fail(self):
        self.expect_each_call_site_may_fail(Session)

    def test_each_call_site_of_a_call_may_fail(self):
        self.expect_each_call_site_may_fail(Call)

    @OF_THE_CLIENT
    def test_each_call_site_with_a_recording_may_fail(self):
        with tempfile.TemporaryDirectory() as directory:
            recording = pathlib.Path(directory) / "session.pcapng"
            subprocess.run([CLIENT, "eval", "--record", recording, "--engine", f"{ENGINE} --stdio --isolated", CODE],
                           stdout=subprocess.DEVNULL, check=True)
            for kind in Inspection, Page, Redaction, Replay, ServedReplay:
                with self.subTest(kind.__name__):
                    kind.begin(recording)
                    said = self.expect_each_call_site_may_fail(kind, fewest=1)
                    self.assertLessEqual(kind.SAID, said)

    @OF_THE_CLIENT
    def test_each_call_site_of_the_line_editor_may_fail(self):
        said = self.expect_each_call_site_may_fail(Typed)
        self.assertIn("krutil: cannot read standard input: Input/output error", said)

    @OF_THE_CLIENT
    def test_input_that_cannot_be_read_is_not_the_end_of_input(self):
        directory = os.open("/", os.O_RDONLY)
        self.addCleanup(os.close, directory)
        ended = subprocess.run([CLIENT, "repl", "--engine", f"{ENGINE} --stdio --isolated"], stdin=directory,
                               capture_output=True, text=True, timeout=PATIENCE)
        self.assertEqual((ended.returncode, ended.stdout, ended.stderr),
                         (2, "", "krutil: cannot read standard input: Is a directory\n"))

    def test_whoever_ignores_the_ends_of_processes_does_not_hide_them(self):
        ignoring = ["env", "--ignore-signal=CHLD"]
        ends = "import subprocess; subprocess.run(['sh', '-c', 'exit 3']).returncode"
        engine = f"{ENGINE} --stdio --isolated"
        if PROGRAM == "krutil":
            command = [*ignoring, CLIENT, "eval", "--engine", engine, "import os; os._exit(5)"]
            expected = 3, "", "krutil: the engine exited with code 5 before it answered\n"
        else:
            command = [CLIENT, "eval", "--engine", f"{' '.join(ignoring)} {engine}", ends]
            expected = 0, "3\n", ""
        ended = subprocess.run(command, stdin=subprocess.DEVNULL, capture_output=True, text=True, timeout=PATIENCE)
        self.assertEqual((ended.returncode, ended.stdout, ended.stderr), expected)


if __name__ == "__main__":
    adopt_orphans()
    unittest.main(argv=sys.argv[:1])
