"""Breaks the sources in one place at a time, and shows which breaks no test notices.

    mutate.py BUILD [--count N] [--seed NUMBER] [--jobs N] [PATH...]

BUILD is a build tree whose tests are built and pass. Of all mutants of the sources PATH, those of every room below
without one, N are drawn; all of them are tried when N is 0. A mutant is compiled without optimisation, linked to the
objects of the tree, and run with the tests of its room, which notice it when one fails, or when they take much longer
than they should. What does not compile is no mutant, and another one is drawn.

A header's mutant is compiled with all sources of its room as one, and linked before the tests' objects, so that its
inline functions are the ones that run.

Ctrl-C ends it with what has been tried. Exit code 1: a mutant survived that unnoticed.txt does not explain.
"""

import argparse
import collections
import concurrent.futures
import dataclasses
import json
import os
import pathlib
import random
import re
import shlex
import signal
import subprocess
import sys
import tempfile
import threading
import time

import mutants

HERE = pathlib.Path(__file__).resolve().parent
ROOT = HERE.parent.parent


@dataclasses.dataclass(frozen=True)
class Room:
    folder: str
    names: tuple  # patterns of what is mutated
    objects: str  # the target that compiles it
    tests: tuple  # programs that link its objects, the quickest first


SESSION = "platform/src/foundation/msg_svc/transport/layers/session"
ROOMS = (
    Room("src/qvm_services/krutil_protobuf", ("*.cpp", "*.hpp"), "krutil_protobuf_code",
         ("tests/krutil_protobuf/krutil_serializers_test",)),
    Room(SESSION, ("Exchanges.cpp", "FrameHeader.cpp", "Incoming.cpp", "WireWalk.cpp"), "krutil_platform_code",
         ("tests/platform/session_parts_test", "tests/platform/session_memory_test", "tests/platform/session_test")),
)


def sources_of(room):
    """What is mutated."""
    return [str(path.relative_to(ROOT)) for name in room.names for path in sorted((ROOT / room.folder).glob(name))]


def fail(text):
    sys.exit(f"mutate: {text}")


class Tree:
    """The build tree: how its objects are compiled, and its test programs linked."""

    def __init__(self, build):
        self.build = pathlib.Path(build).resolve()
        commands = json.loads((self.build / "compile_commands.json").read_text())
        self.objects = {}  # by target and source
        for entry in commands:
            words = shlex.split(entry["command"])
            made = words[words.index("-o") + 1]
            target = made.partition("CMakeFiles/")[2].partition(".dir/")[0]
            self.objects[target, entry["file"]] = made, words

    def sources(self, room):
        """The sources in the room's folder."""
        return sorted(file for target, file in self.objects
                      if target == room.objects and os.path.dirname(file) == str(ROOT / room.folder))

    def compile(self, room, source, made, *options):
        """Compiles a source with the options of the room's sources. Returns whether it compiled."""
        words = self.objects[room.objects, self.sources(room)[0]][1]
        first = next(place for place, word in enumerate(words) if word.startswith("-"))  # behind launcher and compiler
        kept = words[first : words.index("-o")]
        kept = [word for word in kept if word != "-Werror" and not word.startswith("-g")]
        command = ["clang++", *kept, "-O0", "-w", "-U_FORTIFY_SOURCE", *options, "-o", made, source]
        return subprocess.run(command, cwd=self.build, stdout=subprocess.DEVNULL,
                              stderr=subprocess.DEVNULL).returncode == 0

    def link(self, room, test, mutated, replaced, program):
        """Links a test program with an object in place of those of some sources."""
        lines = subprocess.run(["ninja", "-t", "commands", test], cwd=self.build, check=True, capture_output=True,
                               text=True).stdout.splitlines()
        words = shlex.split(lines[-1])
        words = words[words.index("&&") + 1 : words.index("-o")] + words[words.index("-o") + 2 : -2]
        gone = {self.objects[room.objects, source][0] for source in replaced}
        kept = [word for word in words if word not in gone]
        first = next(place for place, word in enumerate(kept) if word.endswith(".o"))
        command = kept[:first] + [mutated] + kept[first:] + ["-fuse-ld=gold", "-o", program]
        linked = subprocess.run(command, cwd=self.build, capture_output=True, text=True)
        return linked.returncode == 0


def run(program, folder, seconds):
    """Whether all tests passed in so many seconds."""
    process = subprocess.Popen([program, "--gtest_fail_fast", "--gtest_brief=1"], cwd=folder, stdin=subprocess.DEVNULL,
                               stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, start_new_session=True)
    try:
        return process.wait(seconds) == 0
    except subprocess.TimeoutExpired:
        return False
    finally:
        try:
            os.killpg(process.pid, signal.SIGKILL)
        except ProcessLookupError:
            pass
        process.wait()


class Trial:
    """Tries mutants, any number of them at a time."""

    def __init__(self, tree, folder):
        self.tree = tree
        self.folder = folder
        self.headers = {}  # compiled, by room
        self.usual = {}  # seconds, by test program
        self.lock = threading.Lock()

    def prepare(self, room):
        """Compiles what the room includes from elsewhere once, because most of the time would go into that."""
        includes = set()
        for path in sources_of(room):
            for line in re.findall(r'^#include .*', (ROOT / path).read_text(encoding="utf-8"), re.MULTILINE):
                if not (ROOT / room.folder / line.split('"')[1 if '"' in line else 0]).is_file():
                    includes.add(line)
        header = os.path.join(self.folder, room.objects + ".hpp")
        with open(header, "w", encoding="utf-8") as file:
            file.writelines(line + "\n" for line in sorted(includes))
        self.headers[room] = header + ".pch"
        if not self.tree.compile(room, header, self.headers[room], "-x", "c++-header"):
            fail(f"what {room.folder} includes cannot be compiled")

    def programs(self, room, path, folder, *options):
        """Links the room's test programs in a folder, one after the other, with what a source has become."""
        mutated = os.path.join(folder, "mutated.o")
        source = str(ROOT / path)
        if source.endswith(".hpp"):
            replaced = self.tree.sources(room)
            compiled = os.path.join(folder, "room.cpp")
            with open(compiled, "w", encoding="utf-8") as whole:
                whole.writelines(f'#include "{file}"\n' for file in replaced)
        else:
            replaced, compiled = [source], source
        if not self.tree.compile(room, compiled, mutated, "-include-pch", self.headers[room], *options, "-c"):
            return
        for test in room.tests:
            program = os.path.join(folder, "test")
            if not self.tree.link(room, test, mutated, replaced, program):
                return
            yield test, program

    def measure(self, room, path):
        """Runs the tests with a source as it is."""
        with tempfile.TemporaryDirectory() as folder:
            tests = 0
            for test, program in self.programs(room, path, folder):
                begin = time.monotonic()
                if not run(program, folder, 300):
                    fail(f"{test} fails with {path} as it is, compiled without optimisation")
                self.usual[test] = max(time.monotonic() - begin, self.usual.get(test, 0))
                tests += 1
            if tests != len(room.tests):
                fail(f"{path} as it is cannot be compiled and linked")

    def survives(self, room, mutant, text):
        """True, False, or None when it does not compile."""
        with tempfile.TemporaryDirectory() as folder:
            source = str(ROOT / mutant.path)
            changed = os.path.join(folder, "changed")
            with open(changed, "w", encoding="utf-8") as file:
                file.write(mutant.apply(text))
            overlay = os.path.join(folder, "overlay.json")
            with open(overlay, "w", encoding="utf-8") as file:
                json.dump({"version": 0, "use-external-names": False,
                           "roots": [{"type": "file", "name": source, "external-contents": changed}]}, file)
            survived = None
            for test, program in self.programs(room, mutant.path, folder, "-ivfsoverlay", overlay):
                if not run(program, folder, 10 + 5 * self.usual[test]):
                    return False
                survived = True
            return survived


def known():
    """Mutants that nothing can notice, with the reason: lines of unnoticed.txt."""
    found = {}
    for line in (HERE / "unnoticed.txt").read_text(encoding="utf-8").splitlines():
        if line and not line.startswith("#"):
            change, reason = line.split("  # ")
            found[change.strip()] = reason
    return found


def in_one_line(text):
    return " ".join(text.split())


def describe(mutant, text):
    """The change as one line of unnoticed.txt has it: no line numbers, because these move."""
    begin = text.rfind("\n", 0, mutant.begin) + 1
    end = text.find("\n", mutant.end)
    before = in_one_line(text[begin:end])
    after = in_one_line(text[begin : mutant.begin] + mutant.new + text[mutant.end : end])
    return f"{os.path.basename(mutant.path)}: {before}  =>  {after}"


def main():
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("build")
    parser.add_argument("paths", nargs="*", metavar="PATH")
    parser.add_argument("--count", type=int, default=300)
    parser.add_argument("--seed", type=int, default=random.SystemRandom().randrange(1000000))
    parser.add_argument("--jobs", type=int, default=os.cpu_count())
    arguments = parser.parse_intermixed_args()

    paths = {path: room for room in ROOMS for path in sources_of(room)}
    for given in arguments.paths:
        if not any(path.startswith(given) for path in paths):
            fail(f"{given} is neither of these nor a folder of theirs: {' '.join(paths)}")
    texts = {path: (ROOT / path).read_text(encoding="utf-8") for path in paths
             if path.startswith(tuple(arguments.paths or [""]))}
    drawn = [mutant for path, text in texts.items() for mutant in mutants.of_text(path, text)]
    random.Random(arguments.seed).shuffle(drawn)
    count = arguments.count or len(drawn)
    print(f"{len(drawn)} changes of {len(texts)} sources; seed {arguments.seed}", flush=True)

    scratch = tempfile.TemporaryDirectory()
    trial = Trial(Tree(arguments.build), scratch.name)
    for room in sorted(set(paths[path] for path in texts), key=ROOMS.index):
        trial.prepare(room)
        for ending in (".cpp", ".hpp"):
            path = next((path for path in texts if paths[path] is room and path.endswith(ending)), None)
            if path:
                trial.measure(room, path)

    explained = known()
    totals = collections.Counter()
    survivors = 0
    pending = collections.deque()
    waiting = iter(drawn)
    begin = time.monotonic()
    try:
        pool = concurrent.futures.ThreadPoolExecutor(arguments.jobs)
        while totals["tried"] < count:
            while len(pending) < min(arguments.jobs, count - totals["tried"]):
                mutant = next(waiting, None)
                if mutant is None:
                    break
                pending.append((mutant, pool.submit(trial.survives, paths[mutant.path], mutant,
                                                    texts[mutant.path])))
            if not pending:
                break
            mutant, result = pending.popleft()
            survived = result.result()
            if survived is None:
                totals["none"] += 1
                continue
            totals["tried"] += 1
            totals[mutant.kind, survived] += 1
            if survived:
                change = describe(mutant, texts[mutant.path])
                reason = explained.get(change)
                if reason:
                    totals["explained"] += 1
                else:
                    survivors += 1
                print(f"mutant {totals['tried']} survived: {mutant.path}:{mutant.line} ({mutant.kind})\n    {change}"
                      + (f"\n    {reason}" if reason else ""), flush=True)
    except KeyboardInterrupt:
        print("stopped; so far:")
        pool.shutdown(wait=False, cancel_futures=True)
    seconds = time.monotonic() - begin

    for kind in ("operator", "constant", "text", "removed", "order"):
        killed, survived = totals[kind, False], totals[kind, True]
        print(f"{kind:10} {killed:5} of {killed + survived} noticed")
    tried = totals["tried"]
    noticed = tried - survivors - totals["explained"]
    print(f"{tried} mutants, {noticed} noticed ({100 * noticed / max(1, tried):.1f} %), {totals['explained']} that nothing "
          f"can notice, {survivors} survivors; {totals['none']} changes did not compile; {seconds:.0f} s; "
          f"seed {arguments.seed}")
    sys.exit(1 if survivors else 0)


if __name__ == "__main__":
    main()
