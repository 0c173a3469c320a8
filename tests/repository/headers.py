"""Checks the public headers: each compiles on its own, opens with a comment, and its path is its namespace.

    headers.py ROOT BUILD

BUILD holds the compile_commands.json whose options are used.
"""

import concurrent.futures
import json
import os
import re
import shlex
import subprocess
import sys

import checkout

PLATFORM = "platform/include"
PRODUCT = "src/qvm_services/krutil_protobuf"


def public_headers(root):
    """Public headers, each with the directory whose sources know how to compile it."""
    headers = [(path, "platform/src") for path in checkout.files(root, ".hpp") if path.startswith(PLATFORM + "/")]
    return headers + [(f"{PRODUCT}/KrutilProtocol.hpp", PRODUCT)]


def check_shape(path, text):
    """Findings about the text of one header."""
    findings = []
    lines = text.split("\n")
    if not lines[0].startswith("// "):
        findings.append(f"{path}:1: a header opens with a comment that tells its purpose")
    if "#pragma once" not in lines:
        findings.append(f"{path}:1: no #pragma once")
    if path.startswith(PLATFORM + "/"):
        namespace = "::".join(path[len(PLATFORM) + 1 :].split("/")[:-1])
        if not re.search(rf"^namespace {re.escape(namespace)}\b(::\w+)* {{", text, re.MULTILINE):
            findings.append(f"{path}:1: nothing is declared in namespace {namespace}, which the path names")
    return findings


def compile_options(root, build):
    """Directory of sources -> (compiler and options to check syntax with, working directory)."""
    options = {}
    with open(os.path.join(build, "compile_commands.json"), encoding="utf-8") as file:
        commands = json.load(file)
    for entry in commands:
        source = os.path.relpath(entry["file"], os.path.realpath(root))
        for directory in ("platform/src", PRODUCT):
            if source.startswith(directory + "/") and directory not in options:
                words = shlex.split(entry["command"])
                words = words[: words.index("-o")]
                options[directory] = (words + ["-fsyntax-only", "-x", "c++"], entry["directory"])
    return options


def check_alone(root, header, command, directory):
    # Included twice, through an empty source, so that "#pragma once in main file" is no warning.
    source = f'#include "{os.path.join(os.path.realpath(root), header)}"\n' * 2
    done = subprocess.run(command + ["-"], cwd=directory, input=source, capture_output=True, text=True)
    return [] if done.returncode == 0 else [f"{header} does not compile on its own:\n{done.stderr}"]


def check(root, build):
    findings = []
    options = compile_options(root, build)
    with concurrent.futures.ThreadPoolExecutor(os.cpu_count()) as pool:
        pending = []
        for header, directory in public_headers(root):
            findings += check_shape(header, checkout.read(root, header))
            pending.append(pool.submit(check_alone, root, header, *options[directory]))
        for result in pending:
            findings += result.result()
    return findings


if __name__ == "__main__":
    checkout.report(check(sys.argv[1], sys.argv[2]), "public headers")
