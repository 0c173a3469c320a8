"""Says which lines and branches of the libraries and the programs the tests have run, and lists the others.

    report.py BUILD COUNTS MISSED

BUILD is a build tree of the preset coverage, COUNTS a merged profile of its programs, MISSED a file that is written. A
branch is one outcome of a condition as it stands in the source, or one case of a switch. Ways out by an exception are
none, and neither are what the compiler decides, and the case that a switch of all enumerators does not have. What is
compiled more than once, such as the body of a template, counts as run when one of its copies has run.
"""

import collections
import json
import os
import pathlib
import subprocess
import sys

ROOT = pathlib.Path(__file__).resolve().parent.parent.parent
ROOMS = ("src/", "platform/", "apps/")


def programs(build):
    """Programs and shared libraries of the tree."""
    for folder, _, names in os.walk(build):
        for name in names:
            path = os.path.join(folder, name)
            if not os.path.islink(path) and os.access(path, os.X_OK):
                with open(path, "rb") as file:
                    if file.read(4) == b"\x7fELF":
                        yield path


def export(build, counts):
    """What llvm-cov knows of each file: segments of text with a count, and branches."""
    first, *others = programs(build)
    objects = [word for other in others for word in ("-object", other)]
    made = subprocess.run(["llvm-cov-14", "export", "-format=text", "-skip-functions", "-skip-expansions",
                           "-ignore-filename-regex=^/usr/", "-instr-profile", counts, first, *objects],
                          check=True, stdout=subprocess.PIPE, stderr=subprocess.DEVNULL)
    return json.loads(made.stdout)["data"][0]["files"]


def lines_of(segments):
    """How often each line has run; lines without code are left out. A segment reaches up to the next one."""
    lines = {}
    by_line = collections.defaultdict(list)
    for segment in segments:
        by_line[segment[0]].append(segment)
    before = None
    for line in range(segments[0][0], segments[-1][0] + 1) if segments else ():
        here = by_line.get(line, [])
        entries = [count for _, _, count, counted, entry, gap in here if counted and entry and not gap]
        skipped = here and not here[0][3] and here[0][4]
        if not skipped and (entries or (before and before[3])):
            lines[line] = max(entries + ([before[2]] if before and before[3] else []))
        if here:
            before = here[-1]
    return lines


def measured(build, counts):
    """For each source of ours: lines, and the outcomes of conditions by place."""
    lines, branches = collections.defaultdict(collections.Counter), collections.defaultdict(collections.Counter)
    for file in export(build, counts):
        path = os.path.relpath(os.path.normpath(file["filename"]), ROOT)
        if not path.startswith(ROOMS):
            continue
        for line, count in lines_of(file["segments"]).items():
            lines[path][line] = max(lines[path][line], count)
        text = (ROOT / path).read_text(encoding="utf-8").splitlines()
        for line, column, _, _, true, false, *_ in file["branches"]:
            here = text[line - 1]
            if "if constexpr" in here or here[: column - 1].endswith("switch ("):
                continue
            branches[path][line, column, "true"] += true
            branches[path][line, column, "false"] += false
    return lines, branches


def ranges(numbers):
    """[1, 2, 3, 7] as "1-3, 7"."""
    found = []
    for number in sorted(numbers):
        if found and found[-1][1] == number - 1:
            found[-1][1] = number
        else:
            found.append([number, number])
    return ", ".join(str(first) if first == last else f"{first}-{last}" for first, last in found)


def share(kinds):
    run = sum(1 for counts in kinds for count in counts.values() if count)
    there = sum(len(counts) for counts in kinds)
    return f"{run:6} of {there:6} ({100 * run / max(1, there):5.1f} %)"


def main():
    build, counts, missed = sys.argv[1:]
    lines, branches = measured(build, counts)
    with open(missed, "w", encoding="utf-8") as out:
        for path in sorted(lines):
            never = [line for line, count in lines[path].items() if not count]
            if never:
                print(f"{path}: lines {ranges(never)}", file=out)
            for (line, column, outcome), count in sorted(branches[path].items()):
                if not count and line not in never:
                    print(f"{path}:{line}:{column}: never {outcome}", file=out)
    for room in ROOMS:
        inside = [path for path in lines if path.startswith(room)]
        print(f"{room:10} lines {share([lines[path] for path in inside])}   "
              f"branches {share([branches[path] for path in inside])}")


if __name__ == "__main__":
    main()
