"""Configures a build that finds no development files of Python, and looks at what it would make. It compiles nothing: the
build that runs this test has the same sources.

    without_python.py ROOT BUILD COMPILER
"""

import subprocess
import sys
import unittest

ROOT, BUILD, COMPILER = sys.argv[1:]
del sys.argv[1:]


def run(*command):
    return subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True)


def commands_for(*targets):
    return run("ninja", "-C", BUILD, "-t", "commands", *targets)


class WithoutPythonTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        # With tests: those of the programs are left out.
        cls.configured = run("cmake", "-S", ROOT, "-B", BUILD, "-G", "Ninja", "--fresh", f"-DCMAKE_CXX_COMPILER={COMPILER}",
                             "-DCMAKE_DISABLE_FIND_PACKAGE_Python3=ON", "-DKRUTIL_BUILD_TESTS=ON", "-DKRUTIL_BUILD_BENCH=ON")

    def test_the_warning_says_what_is_missing(self):
        self.assertEqual(self.configured.returncode, 0, self.configured.stdout)
        said = " ".join(self.configured.stdout.split())
        self.assertIn("krutil-qvm is not built: it needs the development files of Python 3.11, NumPy and pybind11 "
                      "(python3-dev, python3-numpy and pybind11-dev in Debian). The libraries and the client are built.", said)

    def test_libraries_and_client_are_made_without_python(self):
        planned = commands_for("all")
        self.assertEqual(planned.returncode, 0, planned.stdout[-2000:])
        for made in ("bin/krutil", "libkrutil_protobuf.so", "libkrutil_platform.so", "python/krutil/schema.bin"):
            self.assertIn(made, planned.stdout)
        for absent in ("python3.11", "pybind11", "apps/qvm/", "krutil_option_tables"):
            self.assertNotIn(absent, planned.stdout)

    def test_there_is_no_engine(self):
        planned = commands_for("krutil-qvm")
        self.assertEqual((planned.returncode, planned.stdout.splitlines()[-1]),
                         (1, "ninja: error: unknown target 'krutil-qvm'"))


if __name__ == "__main__":
    unittest.main()
