"""Questions about whole processes, from their start to their end."""

import contextlib
import os
import subprocess
import tempfile
import time

PYTHON = "/usr/bin/python3"


def run_checked(command, expected):
    """Runs a command to its end. What it prints must be `expected`. Returns the seconds that it took."""
    begin = time.perf_counter()
    ended = subprocess.run(command, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, check=True)
    seconds = time.perf_counter() - begin
    if ended.stdout != expected:
        raise RuntimeError(f"{' '.join(command)}: expected {expected[:80]!r}, got {ended.stdout[:80]!r}")
    return seconds


def in_turn(label, repetitions, contenders):
    """A row: the figures of contenders (pairs of a name and a function) that have their turns one after the other."""
    figures = {name: [] for name, _ in contenders}
    for _, work in contenders:
        work()
    for _ in range(repetitions):
        for name, work in contenders:
            figures[name].append(work())
    return {"label": label, "size": None,
            "times": [{"name": name, "seconds": seconds} for name, seconds in figures.items()]}


@contextlib.contextmanager
def listening_engine(run):
    """An engine that listens, and the path of its socket."""
    with tempfile.TemporaryDirectory() as directory:
        path = os.path.join(directory, "private", "engine")
        with subprocess.Popen([run.program("bin", "krutil-qvm"), "--listen", path], stderr=subprocess.PIPE) as engine:
            try:
                line = engine.stderr.readline().decode()
                if line != f"krutil-qvm: serving {path}\n":
                    raise RuntimeError(f"an engine that listens: expected that it serves, got {line!r}")
                yield path
            finally:
                engine.terminate()


def _beside_python(run, name, command):
    return [in_turn("", run.repetitions, [
        ("python3", lambda: run_checked([PYTHON, "-c", "1+1"], b"")),
        (name, lambda: run_checked(command, b"2\n"))])]


def evaluation_with_own_engine(run):
    return _beside_python(run, "krutil", [run.program("bin", "krutil"), "eval", "1+1"])


def evaluation_with_listening_engine(run):
    with listening_engine(run) as path:
        return _beside_python(run, "krutil", [run.program("bin", "krutil"), "eval", "1+1", "--connect", path])
