"""The package as it is given away: its types, and a wheel that is built and used without a network.

    package_test.py CHECKOUT
"""

import os
import shutil
import subprocess
import sys
import tempfile
import unittest

CHECKOUT = os.path.abspath(sys.argv.pop(1))
CLIENT = os.path.join(CHECKOUT, "clients", "python")


class PackageTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cache = tempfile.TemporaryDirectory()
        cls.addClassCleanup(cache.cleanup)
        cls.mypy = ["mypy", "--cache-dir", cache.name]

    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name

    def run_program(self, *command, **options):
        done = subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, **options)
        self.assertEqual(done.returncode, 0, done.stdout)
        return done.stdout

    def test_types(self):
        self.run_program(*self.mypy, "--config-file", os.path.join(CLIENT, "pyproject.toml"),
                         os.path.join(CLIENT, "krutil"), cwd=self.directory)

    def test_types_of_what_a_user_sees(self):
        program = os.path.join(self.directory, "program.py")
        with open(program, "w", encoding="utf-8") as file:
            file.write("import krutil\n"
                       "with krutil.start() as session:\n"
                       "    reveal_type(session.eval('1').value)\n"
                       "    reveal_type(session.submit('1').result())\n"
                       "    session.eval(1)\n")
        done = subprocess.run([*self.mypy, "--config-file", os.path.join(CLIENT, "pyproject.toml"), program],
                              cwd=self.directory, stdout=subprocess.PIPE, text=True, env={**os.environ, "MYPYPATH": CLIENT})
        self.assertIn('program.py:3: note: Revealed type is "Union[builtins.str, None]"', done.stdout)
        self.assertIn('program.py:4: note: Revealed type is "krutil.requests.Result"', done.stdout)
        self.assertIn('program.py:5: error: Argument 1 to "eval" of "Session" has incompatible type "int"; expected "str"',
                      done.stdout)

    def test_wheel(self):
        # What is built leaves files beside its sources, so a copy of these is built.
        for part in (os.path.join("clients", "python"), os.path.join("platform", "proto"),
                     os.path.join("src", "qvm_services", "krutil_protobuf", "proto")):
            shutil.copytree(os.path.join(CHECKOUT, part), os.path.join(self.directory, part),
                            ignore=shutil.ignore_patterns("build", "*.egg-info", "__pycache__"))
        wheels, installed = os.path.join(self.directory, "wheels"), os.path.join(self.directory, "installed")
        pip = [sys.executable, "-m", "pip", "-q", "--no-cache-dir", "--disable-pip-version-check"]
        self.run_program(*pip, "wheel", "--no-index", "--no-deps", "--no-build-isolation", "-w", wheels,
                         os.path.join(self.directory, "clients", "python"))
        self.assertEqual(os.listdir(wheels), ["krutil-0.1.0-py3-none-any.whl"])
        self.run_program(*pip, "install", "--no-index", "--no-deps", "--target", installed,
                         os.path.join(wheels, "krutil-0.1.0-py3-none-any.whl"))
        code = "import krutil\nwith krutil.start() as session: print(krutil.__file__, session.eval('6 * 7').value)"
        environment = {**os.environ, "PYTHONPATH": installed}
        self.assertEqual(self.run_program(sys.executable, "-c", code, env=environment, cwd=self.directory),
                         os.path.join(installed, "krutil", "__init__.py") + " 42\n")


if __name__ == "__main__":
    unittest.main()
