"""The conformance vectors, and random messages, as a library for JavaScript reads and writes them."""

import json
import os
import subprocess
import unittest

ROOT = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "..")
READER = os.path.join(ROOT, "conformance", "readers", "javascript")
SCHEMA = os.path.join(os.environ["KRUTIL_BUILD"], "python", "krutil", "schema.bin")
ECHO = os.path.join(os.environ["KRUTIL_BUILD"], "tests", "conformance", "krutil_conformance_echo")


class JavaScriptTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        # Exactly what package-lock.json names.
        subprocess.run(["npm", "ci", "--ignore-scripts", "--no-audit", "--no-fund"], cwd=READER, check=True)

    def run_node(self, script, *arguments):
        done = subprocess.run(["node", script, *arguments], cwd=READER, stdout=subprocess.PIPE, text=True, check=False)
        return done.stdout, done.returncode

    def test_conformance_vectors(self):
        with open(os.path.join(ROOT, "conformance", "manifest.json"), encoding="utf-8") as file:
            count = len(json.load(file)["vectors"])
        self.assertEqual(self.run_node("check_vectors.mjs", SCHEMA), (f"{count} vectors, 0 findings\n", 0))

    def test_conformance_of_random_messages(self):
        self.assertEqual(self.run_node("exchange.mjs", SCHEMA, ECHO, "100"),
                         ("25 types, 100 messages each: all came back as they were written\n", 0))


if __name__ == "__main__":
    unittest.main()
