"""Checks that what the documents promise is there: targets of relative links, scripts, the client's subcommands; that
C++ in them is quoted from a source that is compiled; that documents which sources mention exist; and that the page of
the messages leaves none out.

    documents.py ROOT [KRUTIL]

KRUTIL is the client program; without it, subcommands are not checked.
"""

import os
import re
import subprocess
import sys

import checkout

LINK = re.compile(r"\[[^\]]*\]\(([^)\s]+)\)")
SCRIPT = re.compile(r"(?<![\w/])\./(scripts/[\w-]+|\.ci/\w+)")
SUBCOMMAND = re.compile(r"^(?:\$ )?krutil ([a-z]+)\b", re.MULTILINE)
QUOTED_FROM = "tests/install/projects/host/host.cpp"
CPP = re.compile(r"^```cpp\n(.*?)^```", re.MULTILINE | re.DOTALL)
MENTION = re.compile(r"\bdocs/[\w-]+\.md\b")
SCHEMA = "src/qvm_services/krutil_protobuf/proto/"
MESSAGES = "docs/protocol.md"
MESSAGE = re.compile(r"^message (\w+)", re.MULTILINE)
BLOCK = re.compile(r"^```\w*\n(.*?)^```", re.MULTILINE | re.DOTALL)


def anchors(text):
    """The fragment names that a Markdown text's headings get."""
    names = set()
    for heading in re.findall(r"^#+ (.*)$", BLOCK.sub("", text), re.MULTILINE):
        names.add(re.sub(r"[^\w -]", "", heading.lower()).replace(" ", "-"))
    return names


def check_links(root, path):
    findings = []
    for target in LINK.findall(BLOCK.sub("", checkout.read(root, path))):
        if re.match(r"[a-z]+:", target):
            continue
        name, _, fragment = target.partition("#")
        file = os.path.normpath(os.path.join(os.path.dirname(path), name)) if name else path
        if not os.path.exists(os.path.join(root, file)):
            findings.append(f"{path}: link to {target}, which does not exist")
        elif fragment and fragment not in anchors(checkout.read(root, file)):
            findings.append(f"{path}: link to {target}, but {file} has no such heading")
    return findings


def check_scripts(root, path):
    findings = []
    for script in sorted(set(SCRIPT.findall(checkout.read(root, path)))):
        if not os.access(os.path.join(root, script), os.X_OK):
            findings.append(f"{path}: ./{script} is not there or cannot be run")
    return findings


def check_subcommands(root, path, krutil):
    findings = []
    blocks = "".join(BLOCK.findall(checkout.read(root, path)))
    for subcommand in sorted(set(SUBCOMMAND.findall(blocks))):
        done = subprocess.run([krutil, subcommand, "--help"], stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        if done.returncode != 0:
            findings.append(f"{path}: krutil has no subcommand {subcommand}")
    return findings


def check_quotations(root, path):
    findings = []
    for block in CPP.findall(checkout.read(root, path)):
        if block not in checkout.read(root, QUOTED_FROM):
            findings.append(f"{path}: its C++ is not what {QUOTED_FROM} says")
    return findings


def check_mentions(root):
    findings = []
    for path in checkout.files(root, ".hpp", ".cpp", ".proto", ".txt", ".cmake"):
        for name in sorted(set(MENTION.findall(checkout.read(root, path)))):
            if not os.path.exists(os.path.join(root, name)):
                findings.append(f"{path}: mentions {name}, which does not exist")
    return findings


def check_messages(root):
    findings = []
    for path in checkout.files(root, ".proto"):
        if path.startswith(SCHEMA):
            for name in MESSAGE.findall(checkout.read(root, path)):
                if not re.search(rf"\b{name}\b", checkout.read(root, MESSAGES)):
                    findings.append(f"{MESSAGES}: nothing about {name}, which {path} defines")
    return findings


def check(root, krutil=None):
    findings = check_mentions(root) + check_messages(root)
    for path in checkout.files(root, ".md"):
        findings += check_links(root, path) + check_scripts(root, path)
        if path == "README.md":
            findings += check_quotations(root, path)
        if krutil:
            findings += check_subcommands(root, path, krutil)
    return findings


if __name__ == "__main__":
    checkout.report(check(*sys.argv[1:]), "documents")
