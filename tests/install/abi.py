"""Compares the ABI of the installed libraries with the recorded one: functions, variables, and the layout of the types
that the installed headers declare.

With --record what this build has is written down; the target krutil_record_exports does that.
"""

import os
import re
import subprocess
import sys
import tempfile
import unittest

from tree import BUILD, CHECKOUT, LIBRARIES, PREFIX, find, main, run

RECORDED = os.path.join(os.path.dirname(os.path.abspath(__file__)), "abi")


def recorded(name):
    return os.path.join(RECORDED, name.replace(".so", ".abi"))


def write_abi(name, path):
    headers = os.path.join(PREFIX, "include", name.removeprefix("lib").removesuffix(".so"))
    run("abidw", "--headers-dir", headers, "--drop-private-types", "--exported-interfaces-only", "--no-corpus-path",
        "--no-comp-dir-path", "--no-show-locs", "--no-parameter-names", "--no-elf-needed", "--type-id-style", "hash",
        "--suppressions", os.path.join(RECORDED, "suppressions.ini"), "--out-file", path, find(name))
    # Sources are named by their places, absolute or from the build tree; they are recorded from the checkout.
    with open(path, encoding="utf-8") as file:
        text = file.read()
    for place in (os.path.realpath(BUILD), os.path.realpath(CHECKOUT)):
        text = text.replace(f"{place}/", "")
    text = re.sub(r"(?<= path=')(\.\./)+", "", text)
    with open(path, "w", encoding="utf-8") as file:
        file.write(text)


class Abi(unittest.TestCase):
    def test_the_abi_is_the_recorded_one(self):
        for name in LIBRARIES:
            with self.subTest(name), tempfile.TemporaryDirectory() as scratch:
                now = os.path.join(scratch, name)
                write_abi(name, now)
                done = subprocess.run(["abidiff", "--no-default-suppression", recorded(name), now],
                                      stdout=subprocess.PIPE, stderr=subprocess.STDOUT, encoding="utf-8")
                # What abidiff cannot read it reports, and ends with 0.
                self.assertEqual((done.returncode, done.stdout), (0, ""),
                                 f"the ABI of {name} is not the recorded one:\n{done.stdout}\nCONTRIBUTING.md says when "
                                 "the SONAME changes; what is meant is recorded by the target krutil_record_exports")


if __name__ == "__main__":
    if sys.argv[1:] == ["--record"]:
        for library in LIBRARIES:
            write_abi(library, recorded(library))
    else:
        main("abidw", "abidiff")
