"""Counts the instructions of the codec samples and compares them with those that were recorded.

    instructions.py PROGRAM [--record]

PROGRAM is krutil_codec_instructions; it runs under callgrind. Each count is a ratio to the bare code of the same sample
in the same run, so it hardly depends on compiler and libraries. Bytes are copied by code that every processor runs, so it
does not depend on the processor. A ratio above the recorded one by more than the tolerance fails. So does one as far below
it: then the record hides how much may be lost again. With --record the ratios of this run become the record,
instructions.json beside this file.
"""

import json
import os
import re
import subprocess
import sys
import tempfile

RECORD = os.path.join(os.path.dirname(os.path.abspath(__file__)), "instructions.json")
BASELINE = "/baseline"
# The C library would choose other ways to copy and compare on another processor.
PLAIN = "glibc.cpu.hwcaps=-AVX2,-AVX_Fast_Unaligned_Load,-ERMS,-SSSE3,-SSE4_1,-SSE4_2"


def count(program):
    """Instructions of each part, by its name."""
    with tempfile.TemporaryDirectory() as directory:
        subprocess.run(
            ["valgrind", "--quiet", "--tool=callgrind", "--collect-atstart=no", "--callgrind-out-file=parts",
             os.path.abspath(program)],
            cwd=directory, check=True, env={**os.environ, "GLIBC_TUNABLES": PLAIN})
        parts = {}
        for name in os.listdir(directory):
            with open(os.path.join(directory, name), encoding="utf-8") as file:
                text = file.read()
            part = re.search(r"^desc: Trigger: Client Request: (.*)$", text, re.MULTILINE)
            total = re.search(r"^(?:summary|totals): (\d+)", text, re.MULTILINE)
            if part:
                parts[part.group(1)] = int(total.group(1))
        return parts


def ratios(parts):
    """Each part's instructions beside its baseline's, by the part's name."""
    return {name: instructions / parts[name + BASELINE] for name, instructions in sorted(parts.items())
            if not name.endswith(BASELINE)}


def findings(measured, record):
    """What differs from the record by more than its tolerance."""
    found = []
    if measured.keys() != record["ratios"].keys():
        found.append(f"expected the parts {sorted(record['ratios'])}, got {sorted(measured)}")
    for name in measured.keys() & record["ratios"].keys():
        expected = record["ratios"][name]
        if abs(measured[name] - expected) > record["tolerance"] * expected:
            found.append(f"{name}: expected {expected:.3f} of the bare code's instructions, got {measured[name]:.3f}")
    return sorted(found)


def main():
    parts = count(sys.argv[1])
    measured = ratios(parts)
    print("instructions against bare code")
    for name, ratio in measured.items():
        print(f"{name:60} {ratio:8.3f}")
    with open(RECORD, encoding="utf-8") as file:
        record = json.load(file)
    if "--record" in sys.argv[2:]:
        record["ratios"] = {name: round(ratio, 3) for name, ratio in measured.items()}
        with open(RECORD, "w", encoding="utf-8") as file:
            json.dump(record, file, indent=4)
            file.write("\n")
        return 0
    found = findings(measured, record)
    for finding in found:
        print(finding, file=sys.stderr)
    if found:
        print(f"The tolerance is {record['tolerance']:.0%}. Find out why, or record the new ratios with --record and say "
              "why in the commit message.", file=sys.stderr)
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main())
