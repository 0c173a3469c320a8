"""Adds the schema to what is built; all else is in pyproject.toml."""

import os
import subprocess
import sys

from setuptools import setup
from setuptools.command.build_py import build_py


class BuildWithSchema(build_py):
    def run(self):
        super().run()
        script = os.path.join(os.path.dirname(os.path.abspath(__file__)), "make_schema.py")
        subprocess.run([sys.executable, script, os.path.join(self.build_lib, "krutil", "schema.bin")], check=True)


setup(cmdclass={"build_py": BuildWithSchema})
