"""The examples in the docstrings, those in the page about the client, and the script in the README.

    examples_test.py PAGE README
"""

import asyncio
import doctest
import importlib
import os
import pkgutil
import re
import subprocess
import sys
import unittest

import krutil
import numpy
from engine_test import Listener
from eventually import PATIENCE

PAGE, README = sys.argv.pop(1), sys.argv.pop(1)

# What needs packages of others, which ./scripts/ecosystem installs and tests.
OPTIONAL = {"krutil.dask", "krutil.notebook"}


class ReadmeTest(unittest.TestCase):
    """With krutil-qvm, whose directory is the first in PATH."""

    def test_the_script_runs_as_it_is_printed(self):
        with open(README, encoding="utf-8") as file:
            script = next(block for block in re.findall(r"^```python\n(.*?)^```", file.read(), re.MULTILINE | re.DOTALL)
                          if "krutil.start(" in block)
        self.assertIn("64 MiB", script)
        done = subprocess.run([sys.executable, "-c", script], capture_output=True, text=True, timeout=PATIENCE)
        self.assertRegex(done.stdout, r"\A[0-9]+\n8388608\.0\n\Z")
        self.assertEqual((done.returncode, done.stderr), (0, ""))


def load_tests(loader, tests, pattern):
    listener = Listener()
    unittest.addModuleCleanup(listener.stop)
    names = {"asyncio": asyncio, "krutil": krutil, "numpy": numpy, "listening_engine": listener.path}
    examples = unittest.TestSuite()
    for module in pkgutil.iter_modules(krutil.__path__, "krutil."):
        if module.name in OPTIONAL:
            continue
        examples.addTests(doctest.DocTestSuite(importlib.import_module(module.name), extraglobs=names))
    examples.addTests(doctest.DocTestSuite(krutil, extraglobs=names))
    examples.addTests(doctest.DocFileSuite(os.path.abspath(PAGE), module_relative=False, globs=names))
    # In this order: the listener stops when the examples, which unittest counts to one module, have run.
    examples.addTests(tests)
    return examples


if __name__ == "__main__":
    unittest.main()
