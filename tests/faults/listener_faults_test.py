"""An engine that listens, with system calls that go wrong at each of the listener's own call sites in turn.

Whatever goes wrong: either the listener ends with exit code 3 and one sentence, or it goes on, serves the next client,
and SIGTERM ends it. It leaves neither its socket nor a process behind, and no descriptor of a session stays open.

    listener_faults_test.py LIBRARY

LIBRARY makes calls go wrong (Faults.cpp). krutil and krutil-qvm are found in the PATH.
"""

import concurrent.futures
import errno
import os
import subprocess
import sys
import tempfile
import unittest

from errors_of_calls import rules
from eventually import PATIENCE, eventually
from processes import Listener, adopt_orphans, all_have_ended, children

LIBRARY = sys.argv[1]

# Where these failed for ever, no listener could work.
WAITING = ("read@", "send@krutil-qvm")

# What a session says whose client goes when its listener has.
LEFT_SESSION = "krutil-qvm: the stream ended between two messages, without the client's goodbye"


class FaultyListener(Listener):
    """It may fail to begin, or to say on standard error that it has begun: its log says it as well."""

    def __init__(self, directory, rule):
        self.log = os.path.join(directory, "log")
        super().__init__(directory, "listener", "--isolated", "--max-sessions", "1", "--handshake-timeout", "3",
                         "--log", self.log, "--diary", os.path.join(directory, "diary"),
                         env=dict(os.environ, LD_PRELOAD=LIBRARY, KRUTIL_FAULTS=f"krutil-qvm {rule}",
                                  KRUTIL_FAULTS_UNFORKED="1"))

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
                if line not in (self.first_words(), LEFT_SESSION)]

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
        """0 when it has ended."""
        try:
            return len(os.listdir(f"/proc/{self.process.pid}/fd"))
        except FileNotFoundError:
            return 0


class Client:
    """One that evaluates code at a listener."""

    def __init__(self, path, code):
        self._output = tempfile.TemporaryFile()
        self._errors = tempfile.TemporaryFile()
        self.process = subprocess.Popen(["krutil", "eval", "--connect", path, code], stdin=subprocess.DEVNULL,
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
    """One listener and its clients."""

    def __init__(self, rule):
        self.once = not rule.startswith("always")
        self.said = self.clients = []
        self.code = None
        try:
            with tempfile.TemporaryDirectory() as directory:
                self.fault = self.run(directory, rule)
        except (AssertionError, OSError, subprocess.TimeoutExpired) as error:
            self.fault = str(error)

    def run(self, directory, rule):
        listener = FaultyListener(directory, rule)
        self.clients = []
        try:
            descriptors = listener.descriptors()
            if listener.first_words() in listener.said() + listener.logged():
                fault = self.visit(listener, directory, descriptors)
            else:
                listener.process.wait(PATIENCE)
                fault = ""
            if listener.has_ended():
                self.code = listener.process.wait()
                expected = [3]
                if len(listener.told()) != 1:
                    fault = f"ended with {len(listener.told())} sentences, expected one"
            else:
                self.code = listener.stop()
                # What the log lacks is in the exit code, and said.
                expected = [0, 3] if listener.told() else [0]
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
        client = Client(listener.path, code)
        self.clients.append(client)
        return client

    def __str__(self):
        return "\n".join([f"exit code {self.code}", "--- listener", *self.said, "--- clients",
                          *(f"{client.process.returncode}: {client.output()!r} {client.errors()!r}"
                            for client in self.clients)])


class ListenerFaultsTest(unittest.TestCase):
    def test_each_call_site_may_fail(self):
        with tempfile.NamedTemporaryFile("r") as listed:
            run = Run(f"list {listed.name}")
            self.assertEqual((run.fault, run.code), ("", 0), str(run))
            self.assertEqual([client.process.returncode for client in run.clients], [0, 5, 0], str(run))
            sites = sorted(set(listed.read().split()))
        # Each step of a listener's life has been there: it begins, accepts, starts a session, refuses, ends.
        self.assertLessEqual({"bind", "listen", "accept4", "fork", "send", "poll"}, {site.split("@")[0] for site in sites})
        # It waits with sessions open, too.
        tried = rules(sites, WAITING) + [f"later {site} {errno.ENOMEM}" for site in sites if site.startswith("poll@")]
        with concurrent.futures.ThreadPoolExecutor(len(os.sched_getaffinity(0))) as workers:
            faults = [f"{rule}: {run.fault}\n{run}" for rule, run in zip(tried, workers.map(Run, tried)) if run.fault]
        self.assertEqual(faults, [], "\n\n".join(faults))
        eventually(all_have_ended, "the end of each process")


if __name__ == "__main__":
    adopt_orphans()
    # Files are closed when nobody knows them any more.
    unittest.main(argv=sys.argv[:1], warnings="ignore")
