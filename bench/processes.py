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
    """An engine that listens: its process and the path of its socket."""
    with tempfile.TemporaryDirectory() as directory:
        path = os.path.join(directory, "private", "engine")
        with subprocess.Popen([run.program("bin", "krutil-qvm"), "--listen", path], stdin=subprocess.DEVNULL,
                              stderr=subprocess.PIPE) as engine:
            try:
                line = engine.stderr.readline().decode()
                if line != f"krutil-qvm: serving {path}\n":
                    raise RuntimeError(f"an engine that listens: expected that it serves, got {line!r}")
                yield engine.pid, path
            finally:
                engine.terminate()


def _beside_python(run, *options):
    return [in_turn("", run.repetitions, [
        ("python3", lambda: run_checked([PYTHON, "-c", "1+1"], b"")),
        ("krutil", lambda: run_checked([run.program("bin", "krutil"), "eval", "1+1", *options], b"2\n"))])]


def evaluation_with_own_engine(run):
    return _beside_python(run)


def evaluation_with_listening_engine(run):
    with listening_engine(run) as (_, path):
        return _beside_python(run, "--connect", path)


def lines_shown(run):
    code = "for i in range(200000): print('line', i)"
    expected = "".join(f"line {i}\n" for i in range(200000)).encode()
    return [in_turn("", max(3, run.repetitions // 2), [
        ("python3 -u", lambda: run_checked([PYTHON, "-u", "-c", code], expected)),
        ("krutil", lambda: run_checked([run.program("bin", "krutil"), "eval", code], expected))])]


def private_bytes(pid):
    """What a process has in memory and shares with no other one."""
    with open(f"/proc/{pid}/smaps_rollup", encoding="ascii") as lines:
        return sum(int(line.split()[1]) * 1024 for line in lines if line.startswith(("Private_Clean", "Private_Dirty")))


@contextlib.contextmanager
def talking(command, expected):
    """A process that has answered a first line, and waits for the next one."""
    with subprocess.Popen(command, stdin=subprocess.PIPE, stdout=subprocess.PIPE) as process:
        process.stdin.write(b"print(1+1)\n")
        process.stdin.flush()
        got = process.stdout.readline()
        if got != expected:
            raise RuntimeError(f"{' '.join(command)}: expected {expected!r}, got {got!r}")
        yield process


def idle_memory(run):
    """The processes of sessions beside as many interpreters; all are there at the same time."""
    count = 4 * min(run.repetitions, 4)
    with contextlib.ExitStack() as stack:
        engine, path = stack.enter_context(listening_engine(run))
        for _ in range(count):
            stack.enter_context(talking([run.program("bin", "krutil"), "repl", "--connect", path], b"2\n"))
        with open(f"/proc/{engine}/task/{engine}/children", encoding="ascii") as children:
            sessions = children.read().split()
        if len(sessions) != count:
            raise RuntimeError(f"an engine that listens: expected {count} processes for as many sessions, "
                               f"got {len(sessions)}")
        loop = "for line in __import__('sys').stdin: exec(line)"
        pythons = [stack.enter_context(talking([PYTHON, "-u", "-c", loop], b"2\n")).pid for _ in range(count)]
        return [{"label": "", "size": None,
                 "times": [{"name": "python3", "seconds": [private_bytes(pid) for pid in pythons]},
                           {"name": "krutil", "seconds": [private_bytes(pid) for pid in sessions]}]}]
