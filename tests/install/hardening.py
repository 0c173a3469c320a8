"""What makes a fault in a release harder to exploit: looked for in the installed files themselves."""

import os
import re
import unittest

from tree import PREFIX, find, main, run

LIBRARIES = ("libkrutil_platform.so", "libkrutil_protobuf.so")
PROGRAMS = ("krutil", "krutil-qvm")


class Hardening(unittest.TestCase):
    def setUp(self):
        self.programs = [os.path.join(PREFIX, "bin", name) for name in PROGRAMS]
        self.paths = [*map(find, LIBRARIES), *self.programs]

    def test_code_and_data_are_apart(self):
        for path in self.paths:
            segments = run("readelf", "--wide", "--program-headers", path)
            self.assertRegex(segments, r"\n  GNU_STACK .* RW +0x")
            self.assertEqual(re.findall(r"\n  LOAD .* RWE ", segments), [])

    def test_addresses_are_unknown(self):
        for path in self.paths:
            self.assertRegex(run("readelf", "--file-header", path), r"Type: +DYN ")

    def test_what_the_linker_has_filled_in_is_read_only(self):
        for path in self.paths:
            self.assertIn("GNU_RELRO", run("readelf", "--wide", "--program-headers", path))
            self.assertRegex(run("readelf", "--wide", "--dynamic", path), r"\(FLAGS_1\) +Flags:.*\bNOW\b")

    def test_stacks_have_a_guard(self):
        for path in self.paths:
            self.assertRegex(run("readelf", "--wide", "--dyn-syms", path), r"UND __stack_chk_fail@")

    def test_functions_of_c_check_sizes(self):
        # Not every library has one whose sizes are known only when it runs.
        for path in self.programs:
            self.assertRegex(run("readelf", "--wide", "--dyn-syms", path), r"UND __\w+_chk@")

    def test_calls_arrive_at_functions_only(self):
        """Functions whose addresses are taken begin with the instruction that says so; all that are exported do."""
        for path in self.paths:
            code = run("objdump", "--disassemble", "--no-show-raw-insn", "--section=.text", path)
            entries = re.findall(r"^[0-9a-f]+ <(main|_ZN6krutil\w+|_ZN10foundation\w+)>:\n +[0-9a-f]+:\t(\w+)", code,
                                 re.MULTILINE)
            marked = sum(instruction == "endbr64" for _, instruction in entries)
            self.assertGreater(marked, len(entries) / 2, entries[:5])


if __name__ == "__main__":
    main()
