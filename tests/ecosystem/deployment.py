"""What tests of docs/deployment.md share: its commands and files as they stand there, a terminal, and engines."""

import glob
import json
import os
import pty
import re
import select
import subprocess
import tempfile
import time
import unittest

import numpy

PATIENCE = 120

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
EXAMPLES = os.path.join(ROOT, "examples")


def block(begin):
    """The one code block of the document that begins with this text."""
    with open(os.path.join(ROOT, "docs", "deployment.md"), encoding="utf-8") as file:
        blocks = re.findall(r"^```\w*\n(.*?)^```$", file.read(), re.MULTILINE | re.DOTALL)
    found = [text for text in blocks if text.startswith(begin)]
    assert len(found) == 1, (begin, found)
    return found[0]


class Terminal:
    """A program on a terminal of its own, which is the terminal that controls it."""

    def __init__(self, arguments, environment):
        self.sent = ""
        self.seen = 0
        self.process, self.descriptor = pty.fork()
        if self.process == 0:
            try:
                os.execvpe(arguments[0], arguments, environment)
            finally:
                os._exit(127)

    def type(self, keys):
        os.write(self.descriptor, keys.encode())

    def expect(self, text):
        """Waits until the terminal has been sent `text` after what the last call waited for."""
        end = time.monotonic() + PATIENCE
        while self.sent.find(text, self.seen) < 0:
            ready, _, _ = select.select([self.descriptor], [], [], max(end - time.monotonic(), 0))
            assert ready, f"expected {text!r}, got {self.sent!r}"
            try:
                piece = os.read(self.descriptor, 4096)
            except OSError:
                piece = b""
            assert piece, f"expected {text!r}, got {self.sent!r} and the end"
            self.sent += piece.decode(errors="replace")
        self.seen = self.sent.find(text, self.seen) + len(text)

    def await_reader(self):
        """Waits until a program in the foreground reads. A signal between its prompt and that may be lost to it."""
        end = time.monotonic() + PATIENCE
        while not any(call.startswith("0 ") for call in self.calls()):
            assert time.monotonic() < end, list(self.calls())
            time.sleep(0.005)

    def calls(self):
        """The system calls that the programs in the foreground are in: their numbers, and more."""
        group = str(os.tcgetpgrp(self.descriptor))
        for directory in glob.glob("/proc/[0-9]*"):
            try:
                with open(f"{directory}/stat", encoding="utf-8") as file:
                    if file.read().rsplit(")", 1)[1].split()[2] != group:
                        continue
                with open(f"{directory}/syscall", encoding="ascii") as file:
                    yield file.read()
            except OSError:
                pass

    def exit_code(self):
        """Waits for the end of the program."""
        while self.process > 0:
            try:
                piece = os.read(self.descriptor, 4096)
            except OSError:
                piece = b""
            self.sent += piece.decode(errors="replace")
            if not piece:
                break
        return os.waitstatus_to_exitcode(os.waitpid(self.process, 0)[1])


class RemoteTest(unittest.TestCase):
    """Processes and files of one test."""

    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name
        self.environment = dict(os.environ, TERM="xterm", NO_COLOR="1", HOME=self.directory,
                                XDG_STATE_HOME=self.directory)

    def path(self, name):
        return os.path.join(self.directory, name)

    def write(self, name, text, mode=0o600):
        with open(self.path(name), "w", encoding="utf-8") as file:
            file.write(text)
        os.chmod(self.path(name), mode)
        return self.path(name)

    def start(self, *arguments, **options):
        """A process that is ended with the test."""
        process = subprocess.Popen(arguments, env=self.environment, **options)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        return process

    def await_file(self, path):
        end = time.monotonic() + PATIENCE
        while not os.path.exists(path):
            self.assertLess(time.monotonic(), end, path)
            time.sleep(0.005)

    def serve(self):
        """A listening engine; returns the path of its socket."""
        path = self.path("engine/socket")
        engine = self.start("krutil-qvm", "--listen", path, stderr=subprocess.PIPE, text=True)
        self.addCleanup(engine.stderr.close)
        self.assertEqual(engine.stderr.readline(), f"krutil-qvm: serving {path}\n")
        return path

    def run_shell(self, command):
        return subprocess.run(command, shell=True, env=self.environment, timeout=PATIENCE, text=True,
                              stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE)

    def assert_runs(self, command, output):
        done = self.run_shell(command)
        self.assertEqual((done.stderr, done.stdout, done.returncode), ("", output, 0), command)

    def features(self, *arguments):
        """What a session settles on in which an array of 8 MiB goes there and back."""
        done = subprocess.run(["krutil", "call", "--json", *arguments, "numpy.negative",
                               "@" + self.array()], env=self.environment, timeout=PATIENCE, stdout=subprocess.PIPE)
        events = [json.loads(line) for line in done.stdout.splitlines()]
        self.assertEqual(done.returncode, 0, events)
        return next(event for event in events if event["event"] == "connected")["features"]

    def array(self):
        path = self.path("array.npy")
        numpy.save(path, numpy.arange(2**20, dtype=numpy.float64))
        return path

    def repl(self, command):
        terminal = Terminal(["krutil", "repl", "--engine", command, "--handshake-timeout", "60"], self.environment)
        self.addCleanup(os.close, terminal.descriptor)
        return terminal

    def assert_survives_ctrl_c(self, terminal):
        terminal.type("print('rea' + 'dy'); exec('while True: pass')\r")
        terminal.expect("ready")
        terminal.type("\x03")
        terminal.expect("cancelled")
        terminal.expect(">>> ")
        terminal.type("6 * 7\r")
        terminal.expect("\n42")
        terminal.expect(">>> ")
        terminal.type("\x04")
        self.assertEqual(terminal.exit_code(), 0)
