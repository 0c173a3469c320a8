"""What the checks of the checkout share: which files there are, and how a check reports."""

import os
import sys

# Directories that hold no text of ours: build trees and what tools leave behind.
SKIPPED = {".git", ".cache", "__pycache__", "build", "node_modules"}


# What programs have said to a person who kept it beside the sources.
KEPT = ".log"


def files(root, *suffixes):
    """Paths of the files below root that end in one of the suffixes (all files without any), relative and sorted."""
    found = []
    for directory, subdirectories, names in os.walk(root):
        subdirectories[:] = [name for name in subdirectories if name not in SKIPPED]
        for name in names:
            path = os.path.relpath(os.path.join(directory, name), root)
            if not path.endswith(KEPT) and (not suffixes or path.endswith(suffixes)):
                found.append(path)
    return sorted(found)


def read(root, path):
    with open(os.path.join(root, path), encoding="utf-8", errors="replace") as file:
        return file.read()


def report(findings, what):
    """Prints the findings, one a line, and ends the program: 1 when there are any."""
    for finding in findings:
        print(finding)
    print(f"{what}: {len(findings)} findings" if findings else f"{what}: in order")
    sys.exit(1 if findings else 0)
