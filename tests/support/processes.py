"""Processes of tests in Python: what they use, who has started whom, and an engine that listens."""

import ctypes
import dataclasses
import os
import statistics
import subprocess
import tempfile

from eventually import PATIENCE, eventually


@dataclasses.dataclass
class Usage:
    """What a process uses: KiB of memory that is its own, descriptors, threads."""
    memory: int
    descriptors: int
    threads: int


def usage(pid):
    """None when the process is gone. Nobody but root may look into one that nobody has waited for."""
    try:
        with open(f"/proc/{pid}/smaps_rollup", encoding="ascii") as file:
            memory = sum(int(line.split()[1]) for line in file if line.startswith("Private_"))
        with open(f"/proc/{pid}/status", encoding="ascii") as file:
            threads = next(int(line.split()[1]) for line in file if line.startswith("Threads:"))
        return Usage(memory, len(os.listdir(f"/proc/{pid}/fd")), threads)
    except (FileNotFoundError, PermissionError, ProcessLookupError, StopIteration):
        return None


def growth(samples):
    """What is used in the last third more than in the second, as a Usage of differences of medians."""
    third = len(samples) // 3
    middle, last = samples[third:2 * third], samples[2 * third:]
    return Usage(*(int(statistics.median(getattr(each, field.name) for each in last)
                       - statistics.median(getattr(each, field.name) for each in middle))
                   for field in dataclasses.fields(Usage)))


def children(pid):
    """Those that the main thread of a process has started or adopted; none of a process that has gone."""
    try:
        with open(f"/proc/{pid}/task/{pid}/children", encoding="ascii") as file:
            return [int(child) for child in file.read().split()]
    except (FileNotFoundError, ProcessLookupError):
        return []


def adopt_orphans():
    """Processes whose parent ends become children of this one, so that it sees who is left."""
    pr_set_child_subreaper = 36
    ctypes.CDLL(None).prctl(pr_set_child_subreaper, 1, 0, 0, 0)


def all_have_ended():
    """Takes leave of children that have ended, those that were left to this process among them."""
    while True:
        try:
            child, _ = os.waitpid(-1, os.WNOHANG)
        except ChildProcessError:
            return True
        if child == 0:
            return False


class Listener:
    """An engine that listens in a directory of its own."""

    def __init__(self, directory, name, *options, env=None):
        self.path = os.path.join(directory, name, "engine")
        self._said = tempfile.TemporaryFile()
        self.process = subprocess.Popen(["krutil-qvm", "--listen", self.path, *options], stderr=self._said, env=env)
        eventually(lambda: self.has_spoken() or self.process.poll() is not None, "the first words of a listener")
        self.expect_serving()

    def has_spoken(self):
        return bool(self.said())

    def expect_serving(self):
        if self.said() != [f"krutil-qvm: serving {self.path}"]:
            raise AssertionError(f"first words of a listener: expected that it serves {self.path}, got {self.said()}")

    def said(self):
        """The whole lines so far."""
        text = os.pread(self._said.fileno(), os.fstat(self._said.fileno()).st_size, 0)
        return text[:text.rfind(b"\n") + 1].decode(errors="backslashreplace").splitlines()

    def stop(self):
        """Waits for the end of its sessions, and ends it. Returns its exit code."""
        eventually(lambda: not children(self.process.pid), "the end of each session of a listener")
        self.process.terminate()
        return self.process.wait(PATIENCE)
