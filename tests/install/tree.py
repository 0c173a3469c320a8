"""The installed tree that the tests of this directory look at, and the compilers of its users."""

import os
import re
import shutil
import subprocess
import sys
import unittest

BUILD = os.environ["KRUTIL_BUILD"]
PREFIX = os.environ["KRUTIL_PREFIX"]
CHECKOUT = os.environ["KRUTIL_CHECKOUT"]
# The options without which a program cannot be linked to the libraries of this build (sanitizers), as one word.
LINK_FLAGS = os.environ["KRUTIL_LINK_FLAGS"]
# A sanitizer's libraries are loaded by programs of the same compiler only.
COMPILERS = [os.environ["KRUTIL_COMPILER"]] if LINK_FLAGS else ["g++", "clang++"]
# Whether this build is one as whose symbols and ABI have been recorded.
COMPARE_WITH_RECORDED = os.environ["KRUTIL_COMPARE_WITH_RECORDED"] == "1"
PROJECTS = os.path.join(os.path.dirname(os.path.abspath(__file__)), "projects")
LIBRARIES = ("libkrutil_protobuf.so", "libkrutil_platform.so")


def run(*command, **options):
    """Runs a command and returns what it printed; fails with all of that when the command fails."""
    done = subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, encoding="utf-8", **options)
    if done.returncode != 0:
        raise AssertionError(f"{' '.join(command)}\nexit code {done.returncode}\n{done.stdout}")
    return done.stdout


def find(name):
    """The path of the one file of that name below the prefix."""
    found = [os.path.join(directory, name) for directory, _, names in os.walk(PREFIX) if name in names]
    if len(found) != 1:
        raise AssertionError(f"{name}: expected once below the prefix, found {found}")
    return found[0]


def library_directory():
    return os.path.dirname(find("libkrutil_protobuf.so"))


def loaded_libraries(program):
    """Where the program's libraries of ours are loaded from."""
    loaded = re.findall(r"libkrutil_\w+\.so\S* => (\S+)", run("ldd", program))
    return {os.path.dirname(os.path.realpath(path)) for path in loaded}


def main(*tools):
    for tool in (*tools, *COMPILERS):
        if shutil.which(tool) is None:
            sys.exit(f"{tool} is not installed")
    unittest.main(verbosity=2)
