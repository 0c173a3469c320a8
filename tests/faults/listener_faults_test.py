"""An engine that listens, with system calls that go wrong at each of the listener's own call sites in turn, and at each
of those of the sessions that it has forked.

Whatever goes wrong in the listener: either it ends with exit code 3 and one sentence, or it goes on, serves the next
client, and SIGTERM ends it. It leaves neither its socket nor a process behind, and no descriptor of a session stays open.

Whatever goes wrong in a session: its client has all that it has asked for, or says what has happened; and the listener
goes on as if nothing had been.

    listener_faults_test.py LIBRARY

LIBRARY makes calls go wrong (Faults.cpp). krutil and krutil-qvm are found in the PATH.
"""

import concurrent.futures
import errno
import os
import re
import subprocess
import sys
import tempfile
import unittest

import numpy

from errors_of_calls import rules
from eventually import PATIENCE, eventually
from processes import Listener, adopt_orphans, all_have_ended, children

LIBRARY = sys.argv[1]

# Where these failed for ever, no listener could work.
WAITING = ("read@", "send@krutil-qvm")

# What a session says whose client goes when its listener has.
LEFT_SESSION = re.compile("krutil-qvm: (the stream ended between two messages, without the client's goodbye$"
                          "|.* during the handshake\\b)")


class FaultyListener(Listener):
    """It may fail to begin, or to say on standard error that it has begun: its log says it as well."""

    def __init__(self, directory, rule, where="first", *options):
        self.log = os.path.join(directory, "log")
        super().__init__(directory, "listener", "--isolated", "--handshake-timeout", "3",
                         "--log", self.log, "--diary", os.path.join(directory, "diary"), *options,
                         env=dict(os.environ, LD_PRELOAD=LIBRARY, KRUTIL_FAULTS=f"krutil-qvm {rule}",
                                  KRUTIL_FAULTS_IN=where))

    def logged(self):
        """What its own lines in the log say."""
        try:
            with open(self.log, encoding="utf-8") as file:
                lines = [line.split(" ", 2) for line in file]
        except FileNotFoundError:
            return []
        return ["krutil-qvm: " + line[2].rstrip("\n") for line in lines if line[1:2] == [str(self.process.pid)]]

    def told(self):
        """What it has told in either place, without that it serves, and without what its sessions say."""
        return [line for line in dict.fromkeys(self.said() + self.logged())
                if line != self.first_words() and not LEFT_SESSION.match(line)]

    def first_words(self):
        return f"krutil-qvm: serving {self.path}"

    def has_spoken(self):
        return bool(self.said() or self.logged())

    def expect_serving(self):
        pass

    def has_ended(self):
        return self.process.poll() is not None

    def has_clients_wait(self):
        return any(line.endswith("; clients wait meanwhile") for line in self.told())

    def descriptors(self):
        """0 when it has ended. Nobody but root may look into a process that has."""
        try:
            return len(os.listdir(f"/proc/{self.process.pid}/fd"))
        except (FileNotFoundError, PermissionError):
            return 0


class Client:
    """One that evaluates code at a listener, or calls a function there."""

    def __init__(self, path, command, *arguments):
        self._output = tempfile.TemporaryFile()
        self._errors = tempfile.TemporaryFile()
        self.process = subprocess.Popen(["krutil", command, "--connect", path, *arguments], stdin=subprocess.DEVNULL,
                                        stdout=self._output, stderr=self._errors)

    def output(self):
        return os.pread(self._output.fileno(), 10_000, 0).decode()

    def errors(self):
        return os.pread(self._errors.fileno(), 10_000, 0).decode()

    def has_ended(self):
        return self.process.poll() is not None

    def end(self):
        """Ends it when it waits still."""
        if not self.has_ended():
            self.process.terminate()
        self.process.wait(PATIENCE)


class Run:
    """A listener with a rule for its faults, and its clients. `start()` starts it; `drive()` has clients there until all
    have ended, the listener too, and returns which exit codes may be and what was wrong."""

    def __init__(self, rule):
        self.once = not rule.startswith("always")
        self.said = []
        self.clients = []
        self.code = None
        try:
            with tempfile.TemporaryDirectory() as directory:
                self.fault = self.run(self.start(directory, rule), directory)
        except (AssertionError, OSError, subprocess.TimeoutExpired) as error:
            self.fault = str(error)

    def run(self, listener, directory):
        try:
            expected, fault = self.drive(listener, directory)
        finally:
            for client in self.clients:
                client.end()
            self.said = listener.said() + listener.logged()
            if not listener.has_ended():
                listener.process.kill()
                listener.process.wait()
        if self.code not in expected:
            return f"ended with {self.code}, expected one of {expected}"
        if any(not line.startswith("krutil-qvm: ") for line in self.said):
            return "said something that is no sentence"
        return "left its socket" if os.path.lexists(listener.path) else fault

    def __str__(self):
        return "\n".join([f"exit code {self.code}", "--- listener", *self.said, "--- clients",
                          *(f"{client.process.returncode}: {client.output()!r} {client.errors()!r}"
                            for client in self.clients)])


class ListenerRun(Run):
    """A listener that fails itself."""

    @staticmethod
    def start(directory, rule):
        return FaultyListener(directory, rule, "first", "--max-sessions", "1")

    def drive(self, listener, directory):
        descriptors = listener.descriptors()
        if listener.first_words() in listener.said() + listener.logged():
            fault = self.visit(listener, directory, descriptors)
        else:
            listener.process.wait(PATIENCE)
            fault = ""
        if listener.has_ended():
            self.code = listener.process.wait()
            told = len(listener.told())
            return [3], fault if told == 1 else f"ended with {told} sentences, expected one"
        self.code = listener.stop()
        # What the log lacks is in the exit code, and said.
        return [0, 3] if listener.told() else [0], fault

    def visit(self, listener, directory, descriptors):
        """A client, a second one while it is there, and one after it; what is wrong."""
        # Whoever cannot be served for ever is told, or waits and the listener tells.
        def is_over(client):
            return client.has_ended() or listener.has_ended() or (not self.once and listener.has_clients_wait())

        path = os.path.join(directory, "held")
        os.mkfifo(path)
        held = os.open(path, os.O_RDWR)
        first = self.client(listener, f"held = open({path!r}); print('here', flush=True); held.read()")
        eventually(lambda: first.output() or is_over(first), "the first words of a client")
        second = self.client(listener, "6 * 7")
        eventually(lambda: is_over(second), "the end of a client beyond the limit of sessions")
        os.close(held)
        eventually(lambda: is_over(first), "the end of a client")
        for client in first, second:
            client.end()
        eventually(lambda: not children(listener.process.pid), "the end of the first sessions")
        third = self.client(listener, "6 * 7")
        eventually(lambda: is_over(third), "the end of a client")
        third.end()
        served = third.process.returncode == 0 and third.output() == "42\n"
        if not served and (self.once or not (third.errors() or listener.has_clients_wait())):
            # Its socket goes a moment before the listener does.
            try:
                listener.process.wait(PATIENCE)
                return ""
            except subprocess.TimeoutExpired:
                pass
            return f"the next session: expected 42, got exit code {third.process.returncode} and {third.output()!r}"
        eventually(lambda: listener.descriptors() <= descriptors,
                   f"the number of descriptors before any session, {descriptors},")
        return ""

    def client(self, listener, code):
        client = Client(listener.path, "eval", code)
        self.clients.append(client)
        return client


class SessionRun(Run):
    """A listener whose sessions fail: one with an evaluation, and one with a call of a large array."""

    CODE = "import os\nprint('by Python')\nb = os.write(1, b'past Python\\n')\nb"
    OUTPUTS = [{"by Python", "past Python", "12"}, {"int64: 300000"}]

    @staticmethod
    def start(directory, rule):
        return FaultyListener(directory, rule, "forked", "--record", os.path.join(directory, "recording"))

    def drive(self, listener, directory):
        descriptors = listener.descriptors()
        array = os.path.join(directory, "array.npy")
        numpy.save(array, numpy.arange(300_000) / 8)
        self.clients = [Client(listener.path, "eval", "--diary", "--log", self.CODE),
                        Client(listener.path, "call", "numpy.size", array)]
        for client in self.clients:
            eventually(client.has_ended, "the end of a client")
        eventually(lambda: listener.descriptors() <= descriptors,
                   f"the number of descriptors before any session, {descriptors},")
        self.code = listener.stop()
        return [0, 3], next(filter(None, map(self.fault_of, self.clients, self.OUTPUTS)), "")

    @staticmethod
    def fault_of(client, output):
        code, errors = client.process.returncode, client.errors().splitlines()
        whole = set(client.output().splitlines()) == output
        if not 0 <= code <= 6:
            return f"a client ended with {code}"
        if not whole and (code == 0 or not any(line.startswith("krutil: ") for line in errors)):
            return "a client lost output without a word"
        return ""


class ListenerFaultsTest(unittest.TestCase):
    def test_each_call_site_may_fail(self):
        with tempfile.NamedTemporaryFile("r") as listed:
            run = ListenerRun(f"list {listed.name}")
            self.assertEqual((run.fault, run.code), ("", 0), str(run))
            self.assertEqual([client.process.returncode for client in run.clients], [0, 5, 0], str(run))
            sites = sorted(set(listed.read().split()))
        # Each step of a listener's life has been there: it begins, accepts, starts a session, refuses, ends.
        self.assertLessEqual({"bind", "listen", "accept4", "fork", "send", "poll"}, {site.split("@")[0] for site in sites})
        # It waits with sessions open, too.
        tried = rules(sites, WAITING) + [f"later {site} {errno.ENOMEM}" for site in sites if site.startswith("poll@")]
        self.expect_no_faults(ListenerRun, tried)

    def test_each_call_site_of_a_session_may_fail(self):
        with tempfile.NamedTemporaryFile("r") as listed:
            run = SessionRun(f"list {listed.name}")
            self.assertEqual((run.fault, [client.process.returncode for client in run.clients]), ("", [0, 0]), str(run))
            sites = sorted(set(listed.read().split()))
        # Its own beginning, its files, what its code writes, and memory that both ends see.
        self.assertLessEqual({"setrlimit", "open", "pipe2", "mmap", "writev"}, {site.split("@")[0] for site in sites})
        # For ever they fail in engines of one session, which do the same.
        self.expect_no_faults(SessionRun, rules(sites, waiting=""))

    def expect_no_faults(self, kind, tried):
        with concurrent.futures.ThreadPoolExecutor(2 * len(os.sched_getaffinity(0))) as workers:
            faults = [f"{rule}: {run.fault}\n{run}" for rule, run in zip(tried, workers.map(kind, tried)) if run.fault]
        self.assertEqual(faults, [], "\n\n".join(faults))
        eventually(all_have_ended, "the end of each process")


if __name__ == "__main__":
    adopt_orphans()
    # Files are closed when nobody knows them any more.
    unittest.main(argv=sys.argv[:1], warnings="ignore")
