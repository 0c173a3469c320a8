"""Checks that clang-format leaves the sources as they are. Exit code 77 (skipped) where it is not installed.

    format.py ROOT
"""

import re
import shutil
import subprocess
import sys

import checkout

if __name__ == "__main__":
    root = sys.argv[1]
    program = shutil.which("clang-format-14") or shutil.which("clang-format")
    if program is None:
        print("clang-format is not installed; nothing was checked")
        sys.exit(77)
    sources = checkout.files(root, ".cpp", ".hpp")
    done = subprocess.run([program, "--dry-run", "-Werror", *sources], cwd=root, capture_output=True, text=True)
    changed = sorted(set(re.findall(r"^([^:\n]+):\d+:\d+: error: ", done.stderr, re.MULTILINE)))
    if changed:
        checkout.report([f"clang-format -i {path}" for path in changed], "format")
    checkout.report([done.stderr] if done.returncode != 0 else [], "format")
