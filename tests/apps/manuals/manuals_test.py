"""Compares the manual pages and completions with the help texts of the programs, and drives the completions.

    manuals_test.py MADE KRUTIL KRUTIL-QVM [TEST...]

MADE is the directory of the pages and completions, the others are the programs.
"""

import os
import pty
import re
import select
import shlex
import subprocess
import sys
import tempfile
import time
import unittest

MADE, *PROGRAMS = sys.argv[1:4]
PAGES = ["krutil.1", "krutil-qvm.1", "krutil-recording.5", "krutil-protocol.7"]
KRUTIL_COMMANDS = re.compile(r"^  (\w+) ", re.MULTILINE)
OPTION = re.compile(r"^  (?:(-\w),)?(--[\w-]+)(?: ([A-Z:]+))?", re.MULTILINE)
PATIENCE = 60


def run(*command, **options):
    """What a command prints; fails when it fails or writes to standard error."""
    done = subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.PIPE, encoding="utf-8", **options)
    if done.returncode != 0 or done.stderr:
        raise AssertionError(f"{shlex.join(command)}\nexit code {done.returncode}\n{done.stderr}\n{done.stdout}")
    return done.stdout


def made(name):
    return os.path.join(MADE, name)


def read(name):
    with open(made(name), encoding="utf-8") as file:
        return file.read()


class Command:
    """A program, or a command of one, with the options of its help text: (short or "", long, value or "")."""

    def __init__(self, path, *name):
        help_text = run(path, *name, "--help")
        self.program = os.path.basename(path)
        self.words = [self.program, *name]
        self.options = OPTION.findall(help_text)
        commands = help_text.partition("\nSubcommands:\n")[2].partition("\n\n")[0]
        self.commands = [Command(path, word) for word in KRUTIL_COMMANDS.findall(commands)]

    def all(self):
        return [self] + self.commands

    def long_names(self):
        return {name for _, name, _ in self.options}


def offered_by_bash(words):
    """What bash's completion offers for the last of the words."""
    script = (f"compopt() {{ :; }}; source {shlex.quote(made(words[0] + '.bash'))}; COMP_WORDS=({shlex.join(words)}); "
              f"COMP_CWORD={len(words) - 1}; _{words[0].replace('-', '_')}; printf '%s\\n' \"${{COMPREPLY[@]}}\"")
    return set(run("bash", "--norc", "-c", script).split("\n")) - {""}


def offered_by_fish(words, home):
    script = f"source {shlex.quote(made(words[0] + '.fish'))}; complete -C {shlex.quote(' '.join(words))}"
    lines = run("fish", "--no-config", "-c", script, env=dict(os.environ, HOME=home)).splitlines()
    return {line.split("\t")[0] for line in lines}


def typed_into_bash(text, until):
    """What a terminal shows when a text is typed into an interactive bash, up to the text that is waited for."""
    pid, fd = pty.fork()
    if pid == 0:
        os.execvpe("bash", ["bash", "--norc", "--noprofile", "-i"],
                   dict(os.environ, TERM="dumb", PS1="ready> ", INPUTRC="/dev/null", HISTFILE=""))
    try:
        shown = ""

        def wait_for(what):
            nonlocal shown
            deadline = time.monotonic() + PATIENCE
            while what not in shown:
                if not select.select([fd], [], [], max(0, deadline - time.monotonic()))[0]:
                    raise AssertionError(f"expected {what!r}, got {shown!r}")
                shown += os.read(fd, 4096).decode()

        wait_for("ready> ")
        os.write(fd, f"source {made('krutil.bash')}; PS1='sourced> '\n".encode())
        wait_for("\r\nsourced> ")
        os.write(fd, text.encode())
        wait_for(until)
        return shown
    finally:
        os.kill(pid, 9)
        os.close(fd)
        os.waitpid(pid, 0)


class Manuals(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.programs = [Command(path) for path in PROGRAMS]
        home = tempfile.TemporaryDirectory()
        cls.addClassCleanup(home.cleanup)
        cls.home = home.name

    def commands(self):
        return [command for program in self.programs for command in program.all()]

    def test_help_texts_are_understood(self):
        krutil, qvm = self.programs
        self.assertLessEqual({"eval", "call", "run", "repl"}, {command.words[1] for command in krutil.commands})
        self.assertIn(("-f", "--file", "FILE"), krutil.commands[0].options)
        self.assertIn(("", "--listen", "PATH"), qvm.options)

    def test_pages_are_free_of_faults(self):
        for page in PAGES:
            with self.subTest(page):
                self.assertEqual(run("mandoc", "-T", "lint", made(page)), "")
                run("man", "--warnings", "--local-file", made(page), env=dict(os.environ, LC_ALL="C.UTF-8"))
                self.assertNotIn("@", read(page).replace("  @FILE", ""))

    def test_pages_tell_of_each_option_and_command(self):
        for command in self.commands():
            text = re.sub(r".\x08", "", run("mandoc", "-T", "utf8", made(command.program + ".1")))
            self.assertRegex(text, rf"(?m)^     +{' '.join(command.words)}\b")
            for short, name, value in command.options:
                entry = (short + ", " if short else "") + name + (" " + value if value else "")
                self.assertRegex(text, rf"(?m)^ +{re.escape(entry)}(  |$| [A-Z])", command.words)

    def test_bash_offers_the_options_of_help(self):
        for command in self.commands():
            expected = command.long_names()
            if command.words == ["krutil"]:
                expected |= Command(PROGRAMS[0], "repl").long_names()
            self.assertEqual(offered_by_bash(command.words + ["--"]), expected, command.words)

    def test_fish_offers_the_options_of_help(self):
        for command in self.commands():
            expected = command.long_names()
            if command.words == ["krutil"]:
                expected |= Command(PROGRAMS[0], "repl").long_names()
            self.assertEqual(offered_by_fish(command.words + ["--"], self.home), expected, command.words)

    def test_zsh_knows_the_options_of_help(self):
        for program in self.programs:
            run("zsh", "--no-rcs", "-n", made("_" + program.program))
            script = read("_" + program.program)
            for command in program.commands or [program]:
                part = script.partition(f"    {command.words[-1]})\n")[2].partition(";;")[0]
                self.assertLessEqual(command.long_names(), set(re.findall(r"'(--[\w-]+)=?\[", part or script)),
                                     command.words)

    def test_values_are_offered(self):
        self.assertEqual(offered_by_bash(["krutil", "eval", "--type", ""]), {"block", "conventional", "script"})
        self.assertEqual(offered_by_bash(["krutil", "eval", "--color", "=", "a"]), {"always", "auto"})
        self.assertEqual(offered_by_bash(["krutil", "--color", "n"]), {"never"})
        self.assertEqual(offered_by_bash(["krutil", "eval", "--handshake-timeout", ""]), set())
        self.assertEqual(offered_by_bash(["krutil-qvm", "--listen", "/etc/passw"]) & {"/etc/passwd"}, {"/etc/passwd"})
        self.assertEqual(offered_by_bash(["krutil", "run", "/etc/passw"]) & {"/etc/passwd"}, {"/etc/passwd"})
        self.assertEqual(offered_by_bash(["krutil", "run", "x.py", "--", "/etc/passw"]) & {"/etc/passwd"},
                         {"/etc/passwd"})
        self.assertIn("bash", offered_by_bash(["krutil", "eval", "--engine", "bas"]))

    def test_commands_are_offered(self):
        expected = {command.words[1] for command in self.programs[0].commands}
        self.assertEqual(offered_by_bash(["krutil", ""]), expected)
        self.assertEqual(offered_by_fish(["krutil", ""], self.home), expected)

    def test_an_interactive_bash_completes(self):
        typed_into_bash("krutil ev\t", "krutil eval ")
        typed_into_bash("krutil eval --spar\t", "krutil eval --sparingly ")
        typed_into_bash("krutil eval --color=al\t", "krutil eval --color=always ")


if __name__ == "__main__":
    unittest.main(argv=sys.argv[:1] + sys.argv[4:], verbosity=2)
