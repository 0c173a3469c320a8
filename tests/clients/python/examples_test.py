"""The examples in the docstrings, and those in the page about the client.

    examples_test.py PAGE
"""

import asyncio
import doctest
import importlib
import os
import pkgutil
import sys
import unittest

import krutil
import numpy
from engine_test import Listener

PAGE = sys.argv.pop(1)

# What needs packages of others, which ./scripts/ecosystem installs and tests.
OPTIONAL = {"krutil.dask", "krutil.notebook"}


def load_tests(loader, tests, pattern):
    listener = Listener()
    unittest.addModuleCleanup(listener.stop)
    names = {"asyncio": asyncio, "krutil": krutil, "numpy": numpy, "listening_engine": listener.path}
    for module in pkgutil.iter_modules(krutil.__path__, "krutil."):
        if module.name in OPTIONAL:
            continue
        tests.addTests(doctest.DocTestSuite(importlib.import_module(module.name), extraglobs=names))
    tests.addTests(doctest.DocTestSuite(krutil, extraglobs=names))
    tests.addTests(doctest.DocFileSuite(os.path.abspath(PAGE), module_relative=False, globs=names))
    return tests


if __name__ == "__main__":
    unittest.main()
