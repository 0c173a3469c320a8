"""krutil inspect of a recording that is not over: a file that still grows, a pipe that is silent, and Ctrl-C meanwhile.

    inspect_following_test.py KRUTIL [TEST...]
"""

import array
import fcntl
import json
import os
import signal
import subprocess
import sys
import tempfile
import termios
import unittest

from eventually import PATIENCE, eventually
from recorded_session import GOODBYE, SHUTDOWN, recorded, reply, request, text

KRUTIL = sys.argv[1]
LATE = 'message on stream 1: "krutil:IIPReply" is a reply: expected the stream ID of an open exchange'


class Follower:
    """A program that reads a pipe of the test."""

    def __init__(self, *arguments):
        output, self.input = os.pipe()
        self.program = subprocess.Popen([KRUTIL, *arguments], stdin=output, stdout=subprocess.PIPE,
                                        stderr=subprocess.PIPE)
        self.output = output

    def __enter__(self):
        return self

    def __exit__(self, *error):
        self.program.kill()
        self.program.communicate()
        for end in self.output, self.input:
            os.close(end)

    def feed(self, content):
        """Returns when the program has read all of it, and waits for more."""
        assert os.write(self.input, content) == len(content)
        unread = array.array("i", [1])
        def taken():
            fcntl.ioctl(self.output, termios.FIONREAD, unread)
            with open(f"/proc/{self.program.pid}/stat", encoding="ascii") as file:
                state = file.read().rpartition(")")[2].split()[0]
            return unread[0] == 0 and state == "S"
        eventually(taken, "the program's wait for more")

    def line(self):
        return self.program.stdout.readline().decode()

    def interrupt(self):
        """Exit code, standard output and standard error of a program whose pipe stays open."""
        self.program.send_signal(signal.SIGINT)
        out, err = self.program.communicate(timeout=PATIENCE)
        return self.program.returncode, out.decode(), err.decode()


class InspectFollowingTest(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name
        self.file = os.path.join(self.directory, "session.pcapng")
        self.copy = os.path.join(self.directory, "copy.pcapng")

    def inspect(self, *options):
        """Exit code, standard output and standard error."""
        done = subprocess.run([KRUTIL, "inspect", *options, self.file], stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, encoding="utf-8", timeout=PATIENCE,
                              check=False)
        return done.returncode, done.stdout, done.stderr

    def write(self, content):
        with open(self.file, "wb") as file:
            file.write(content)

    def test_ctrl_c_while_a_pipe_is_silent(self):
        whole = recorded((">", request()), ("<", text(1, b"a")), ("<", reply())).bytes()
        self.write(whole)
        for options in (), ("--frames",), ("--timeline",):
            with self.subTest(options), Follower("inspect", *options, "-") as follower:
                follower.feed(whole)
                # What was complete is shown, and nothing else.
                self.assertEqual(follower.interrupt(), (6, self.inspect(*options)[1], "krutil: cancelled\n"))
        with Follower("inspect", "--json", "-") as follower:
            follower.feed(whole)
            code, out, err = follower.interrupt()
            self.assertEqual((code, err), (6, "krutil: cancelled\n"))
            self.assertEqual(out, self.inspect("--json")[1]
                             + '{"event":"failure","exitCode":6,"text":"cancelled"}\n')

    def test_ctrl_c_within_what_is_not_complete(self):
        recording = recorded((">", request()), ("<", text(1, b"a")))
        whole = recording.bytes()
        self.write(b"".join(recording.blocks[:-1]))
        with Follower("inspect", "-") as follower:
            follower.feed(whole[:-5])
            self.assertEqual(follower.interrupt(), (6, self.inspect()[1], "krutil: cancelled\n"))
        with Follower("inspect", "--timeline", "-") as follower:
            # A request that may still be answered.
            follower.feed(whole)
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))
        with Follower("inspect", "-") as follower:
            # Before the first session.
            follower.feed(whole[:7])
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))

    def test_ctrl_c_while_rules_are_checked(self):
        with Follower("inspect", "--lint", "-") as follower:
            follower.feed(recorded((">", request())).bytes())
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))
        broken = recorded((">", request()), ("<", reply()), ("<", reply()))
        offset = sum(map(len, broken.blocks[:-1]))
        with Follower("inspect", "--lint", "-") as follower:
            follower.feed(broken.bytes())
            self.assertEqual(follower.interrupt(),
                             (6, f"standard input, byte {offset}: {LATE}\n", "krutil: cancelled\n"))

    def test_ctrl_c_while_a_page_or_a_copy_is_made(self):
        whole = recorded((">", request())).bytes()
        with Follower("inspect", "--html", self.copy, "-") as follower:
            follower.feed(whole)
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))
            self.assertFalse(os.path.exists(self.copy))
        with Follower("inspect", "--redact", self.copy, "-") as follower:
            follower.feed(whole)
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))
        self.file = self.copy
        self.assertEqual(self.inspect("--lint"), (0, "no rule is broken in 6 units of 1 sessions\n", ""))

    def test_ctrl_c_while_a_recording_to_replay_is_read(self):
        with Follower("replay", "-") as follower:
            follower.feed(recorded((">", request())).bytes())
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))

    def test_messages_are_shown_as_they_come(self):
        recording = recorded((">", request()), ("<", text(1, b"a")), ("<", reply()), (">", GOODBYE), ("<", SHUTDOWN))
        whole = recording.bytes()
        self.write(whole)
        lines = iter(self.inspect()[1].splitlines(keepends=True))
        # Those that are completed by a block; the first two describe the session.
        completed = [0, 0, 2, 1, 1, 1, 0, 1, 1, 0, 1, 1, 1]
        self.assertEqual(len(completed), len(recording.blocks))
        with Follower("inspect", "-") as follower:
            for block, count in zip(recording.blocks, completed):
                follower.feed(block[:-1])
                follower.feed(block[-1:])
                for _ in range(count):
                    self.assertEqual(follower.line(), next(lines))
            self.assertEqual(follower.interrupt(), (6, "", "krutil: cancelled\n"))
        self.assertEqual(list(lines), [])

    def test_broken_rules_are_named_as_they_come(self):
        broken = recorded((">", request()), ("<", reply()), ("<", reply()))
        offset = sum(map(len, broken.blocks[:-1]))
        output = subprocess.Popen([KRUTIL, "inspect", "--lint", "-"], stdin=subprocess.PIPE, stdout=subprocess.PIPE,
                                  stderr=subprocess.PIPE)
        self.addCleanup(output.communicate)
        self.addCleanup(output.kill)
        first = broken.bytes()
        for start in 0, len(first):
            for i in range(0, len(first), 7):
                output.stdin.write(first[i:i + 7])
                output.stdin.flush()
            # The pipe is still open.
            self.assertEqual(output.stdout.readline().decode(),
                             f"standard input, byte {start + offset}: {LATE}\n")
        out, err = output.communicate(timeout=PATIENCE)
        self.assertEqual((output.returncode, out, err), (4, b"", b""))

    def test_every_beginning_of_a_recording_is_checked_as_far_as_it_goes(self):
        # One of the frames is in two packets: the larger one is the first.
        long = text(1, b"x" * 300_000)
        recording = recorded((">", request()), ("<", long), ("<", reply()), (">", GOODBYE), ("<", SHUTDOWN))
        first = max(range(len(recording.blocks)), key=lambda i: len(recording.blocks[i]))
        whole = recording.bytes()
        there = 0
        units = 0
        for i, block in enumerate(recording.blocks):
            for size in 0, 1, 11, len(block) - 1:
                self.write(whole[:there + size])
                if size > 0:
                    end = f"krutil: the recording ends within a block, at byte {there + size}\n"
                elif i == first + 1:
                    end = (f"krutil: the recording ends within a unit, at byte {there}: the one at byte "
                           f"{there - len(recording.blocks[first])} has 262128 of {len(long)} bytes\n")
                else:
                    end = ""
                self.assertEqual(self.inspect("--lint"),
                                 (0, f"no rule is broken in {units} units of {min(units, 1)} sessions\n", end))
            there += len(block)
            units += i > 1 and i != first

    def test_session_that_goes_on_is_followed_to_its_end(self):
        gate = os.path.join(self.directory, "gate")
        os.mkfifo(gate)
        session = subprocess.Popen([KRUTIL, "eval", "--record", self.file,
                                    f"print('begun', flush=True)\nopen({gate!r}).read()"],
                                   stdin=subprocess.DEVNULL, stdout=subprocess.PIPE)
        self.addCleanup(session.communicate)
        self.addCleanup(session.kill)
        self.assertEqual(session.stdout.readline(), b"begun\n")

        # A file that is still written to.
        code, out, err = self.inspect()
        self.assertRegex(out.splitlines()[-1], r'TextBaseEvent, \d+ bytes: output "begun\\n"$')
        self.assertEqual((code, err), (0, ""))
        count = len(self.inspect("--frames")[1].split("\n      byte ")) - 1
        self.assertEqual(self.inspect("--lint"), (0, f"no rule is broken in {count} units of 1 sessions\n", ""))

        following = []
        for option in "--json", "--lint":
            tail = subprocess.Popen(["tail", "-c", "+1", "-s", "0.1", "-f", f"--pid={session.pid}", self.file],
                                    stdin=subprocess.DEVNULL, stdout=subprocess.PIPE)
            follower = subprocess.Popen([KRUTIL, "inspect", option, "-"], stdin=tail.stdout, stdout=subprocess.PIPE,
                                        stderr=subprocess.PIPE)
            tail.stdout.close()
            self.addCleanup(tail.wait)
            self.addCleanup(tail.kill)
            self.addCleanup(follower.communicate)
            self.addCleanup(follower.kill)
            following.append(follower)
        seen = ""
        while '"summary":"output \\"begun\\\\n\\""' not in seen:
            line = following[0].stdout.readline().decode()
            self.assertNotEqual(line, "", seen)
            seen += line
        self.assertNotIn("IIPReply", seen)

        with open(gate, "w", encoding="utf-8"):
            pass
        session.communicate(timeout=PATIENCE)
        self.assertEqual(session.returncode, 0)
        for follower, option in zip(following, ("--json", "--lint")):
            out, err = follower.communicate(timeout=PATIENCE)
            self.assertEqual((0, seen + out.decode(), err.decode()), self.inspect(option))
            seen = ""
        self.assertRegex(out.decode(), r"^no rule is broken in \d+ units of 1 sessions\n$")
        self.assertEqual(json.loads(self.inspect("--json")[1].splitlines()[-1])["type"], "QVMShutdownEvent")


if __name__ == "__main__":
    unittest.main(argv=[sys.argv[0], *sys.argv[2:]])
