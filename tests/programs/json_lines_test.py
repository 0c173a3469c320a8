"""Checks what krutil --json prints against its schema: each event that there is, from real sessions, and from an engine
that sends what real ones seldom do.

    json_lines_test.py SCHEMA KRUTIL FAKE-ENGINE [TEST...]
"""

import json
import os
import pty
import subprocess
import sys
import tempfile
import unittest

import jsonschema

SCHEMA, KRUTIL, FAKE_ENGINE = sys.argv[1:4]
PATIENCE = 100


def strict(part):
    """A schema without room for members that it does not name."""
    if isinstance(part, list):
        return [strict(each) for each in part]
    if not isinstance(part, dict):
        return part
    result = {name: strict(each) for name, each in part.items()}
    if "properties" in result and "required" in result:
        result["additionalProperties"] = False
    return result


def run(*arguments, exit_code=0, typed=None, **environment):
    """The objects that a run of krutil prints; with typed, its standard input is a terminal with that text."""
    controller, terminal = pty.openpty() if typed is not None else (None, None)
    try:
        if typed is not None:
            os.write(controller, typed)
        done = subprocess.run([KRUTIL, *arguments], stdin=subprocess.DEVNULL if typed is None else terminal,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, encoding="utf-8", timeout=PATIENCE,
                              env=dict(os.environ, **environment))
    finally:
        for fd in (controller, terminal):
            if fd is not None:
                os.close(fd)
    if done.returncode != exit_code:
        raise AssertionError(f"{arguments}: expected exit code {exit_code}, got {done.returncode}\n{done.stderr}")
    return [json.loads(line) for line in done.stdout.splitlines()]


def sent(tag, content="", exit_code=0):
    """What krutil prints of an engine that sends one event of its own."""
    return run("eval", "--json", "--engine", f"exec '{FAKE_ENGINE}' event {tag} '{content}'", "1", exit_code=exit_code)


class JsonLines(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        with open(SCHEMA, encoding="utf-8") as file:
            cls.schema = json.load(file)
        jsonschema.Draft202012Validator.check_schema(cls.schema)
        cls.whole = jsonschema.Draft202012Validator(cls.schema)
        # By event, without room for members that the schema does not name; says more than that no event fits.
        definitions = strict(cls.schema["$defs"])
        cls.strict = {name: jsonschema.Draft202012Validator({"$ref": f"#/$defs/{name}", "$defs": definitions})
                      for name in definitions}
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        cls.directory = directory.name

    def sessions(self):
        """The objects of many sessions."""
        yield from run("eval", "--json", "--timing", "--echo", "import sys\nprint('out')\nprint('e', file=sys.stderr)\n2")
        yield from run("eval", "--json", "import warnings\nwarnings.warn('w')\nwarnings.simplefilter('ignore')\n"
                       "warnings.warn('hidden')")
        yield from run("eval", "--json", "try:\n    1 / 0\nexcept ZeroDivisionError as e:\n    raise OSError('no') from e",
                       exit_code=1)
        yield from run("eval", "--json", "1 +", exit_code=1)
        yield from run("eval", "--json", "import os; os.kill(os.getpid(), 9)", exit_code=3)
        yield from run("call", "--json", "numpy.array", "[nan,1]")
        yield from run("call", "--json", "numpy.multiply", "[1,2]", "[1,1j]")
        yield from run("call", "--json", "str.upper", '"a"')
        yield from run("call", "--json", "numpy.zeros", "100000")
        yield from run("call", "--json", "--output", os.path.join(self.directory, "x.npy"), "numpy.ones", "3")
        yield from run("eval", "--json", "input('? ')", typed=b"a line\n")
        yield from run("eval", "--json", "class P:\n def _repr_svg_(self): return '<svg/>'\n"
                       " def _repr_html_(self): return '<b>'\nP()", TMPDIR=self.directory)
        for state in ("IIPDiscardedEvent", "IIPRequeuedEvent", "IIPReactivatedEvent"):
            yield from sent(f"krutil:{state}")
        yield from sent("krutil:capabilities_api:CapabilitiesChanged")

    def check(self, line):
        self.assertIn(line.get("event"), self.strict, line)
        errors = [f"{error.json_path}: {error.message}" for error in self.strict[line["event"]].iter_errors(line)]
        self.assertEqual(errors, [], line)

    def test_each_line_of_each_event_follows_the_schema(self):
        seen = set()
        for line in self.sessions():
            self.check(line)
            self.assertTrue(self.whole.is_valid(line), line)
            seen.add(line["event"])
        events = {reference["$ref"].rpartition("/")[2] for reference in self.schema["oneOf"]}
        self.assertEqual(seen, events)

    def test_lines_that_do_not_follow_it_are_found(self):
        reply = {"event": "reply", "request": "0" * 32, "ok": True}
        self.check(reply)
        for wrong in ({**reply, "ok": False}, {**reply, "request": "0"}, {**reply, "more": 1},
                      {"event": "reply", "ok": True}, {**reply, "event": "text"}, {**reply, "event": "nothing"}):
            with self.assertRaises(AssertionError, msg=wrong):
                self.check(wrong)


if __name__ == "__main__":
    unittest.main(argv=sys.argv[:1] + sys.argv[4:], verbosity=2)
