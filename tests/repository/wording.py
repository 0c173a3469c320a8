"""Checks that the text of the checkout stands on its own.

    wording.py ROOT

Whoever reads the code has the checkout and nothing else: a pointer to a numbered section of some paper, to an entry of
a tracker, or to a directory on the machine of whoever wrote it leads nowhere.
"""

import re
import sys

import checkout

PAPER = "point to documents of this checkout by name, or say what matters here"
PATTERNS = [
    (re.compile(r"\bthe[ ]spec\b|\bspecifica[t]ions?\b", re.IGNORECASE), PAPER),
    (re.compile(r"\bpart \d", re.IGNORECASE), PAPER),
    (re.compile(r"\b(issue|ticket) #?\d", re.IGNORECASE), "say what was wrong; the number leads nowhere"),
]

# Directories that every Debian machine has, names that tests use for what exists nowhere, and our own below a user's
# directory. Any other one is somebody's.
ROOT_DIRECTORIES = {"bin", "dev", "etc", "lib", "proc", "run", "sys", "tmp", "usr", "var",
                    "nonexistent", "nowhere", "krutil"}
ABSOLUTE = re.compile(r"(?<![\w.:/*<>)}\]\\$+@%-])/(\w+)/\w")


def check_text(path, text):
    findings = []
    for number, line in enumerate(text.split("\n"), 1):
        for pattern, advice in PATTERNS:
            for match in pattern.finditer(line):
                findings.append(f'{path}:{number}: "{match[0]}": {advice}')
        for match in ABSOLUTE.finditer(line):
            if match[1] not in ROOT_DIRECTORIES:
                findings.append(f'{path}:{number}: "{match[0]}": a path of one machine')
    return findings


def check(root):
    findings = []
    for path in checkout.files(root):
        findings += check_text("file name", path)
        # Golden bytes are no text, and the licence is quoted as it is.
        if path != "LICENSE" and not path.endswith((".bin", ".png", ".npy")):
            findings += check_text(path, checkout.read(root, path))
    return findings


if __name__ == "__main__":
    checkout.report(check(sys.argv[1]), "wording")
