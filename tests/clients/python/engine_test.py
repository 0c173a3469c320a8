"""Sessions with the real engine, over each kind of stream, with zero copy and without.

The directory of krutil-qvm is the first in PATH.
"""

import contextlib
import io
import os
import pickle
import queue
import signal
import socket
import subprocess
import sys
import tempfile
import threading
import traceback
import tracemalloc
import unittest

import krutil
import numpy
from eventually import PATIENCE, eventually

KiB, MiB = 1 << 10, 1 << 20

PNG = b"\x89PNG\r\n\x1a\n\x00\x00\x00\rIHDR\x00\x00\x00\x02\x00\x00\x00\x01 the rest"
PICTURES = f"""
class Html:
    def __repr__(self): return 'h'
    def _repr_html_(self): return '<i>h</i>'

class Both:
    def __repr__(self): return 'a value'
    def _repr_png_(self): return {PNG}
    def _repr_html_(self): return '<b>zwölf</b>'
"""


class Listener:
    """An engine that listens below a directory of its own."""

    def __init__(self, *options, environment=None):
        self._directory = tempfile.TemporaryDirectory()
        self.path = os.path.join(self._directory.name, "private", "engine")
        self._process = subprocess.Popen(["krutil-qvm", "--listen", self.path, *options], stderr=subprocess.PIPE, text=True,
                                         env=environment)
        said = self._process.stderr.readline()
        assert said == f"krutil-qvm: serving {self.path}\n", said

    def stop(self):
        self._process.terminate()
        rest = self._process.communicate(timeout=PATIENCE)[1]
        self._directory.cleanup()
        return rest


def joined(pieces):
    """(text, kind) pairs, those of one kind in a row as one: on a busy machine text comes in smaller pieces."""
    whole = []
    for text, kind in pieces:
        if whole and whole[-1][1] == kind:
            whole[-1] = (whole[-1][0] + text, kind)
        else:
            whole.append((text, kind))
    return whole


class Behaviour:
    """What is the same over each stream. `self.begin(**options)` makes a session."""

    def test_output_and_value(self):
        with self.begin() as session:
            result = session.eval("print('one'); import sys; print('two', file=sys.stderr)\n{'a': [1]}", timeout=PATIENCE)
            self.assertEqual(result, krutil.Result("one\ntwo\n", "{'a': [1]}", ()))
            self.assertEqual(session.eval("x = 1", timeout=PATIENCE), krutil.Result("", None, ()))
            self.assertEqual(session.eval("None", timeout=PATIENCE).value, None)
            self.assertEqual(session.eval("'zwölf 😀'", timeout=PATIENCE).value, "'zwölf 😀'")

    def test_text_as_it_comes(self):
        seen = []
        with self.begin() as session:
            code = "import sys; print('one'); print('two', file=sys.stderr); print('three')"
            session.eval(code, on_text=lambda text: seen.append((str(text), text.stream)), timeout=PATIENCE)
        self.assertEqual(joined(seen), [("one\n", "output"), ("two\n", "error"), ("three\n", "output")])

    def test_text_of_child_processes(self):
        with self.begin() as session:
            result = session.eval("import os; os.system('echo from a child') and None", timeout=PATIENCE)
            self.assertEqual(result.output, "from a child\n")

    def test_large_output(self):
        with self.begin() as session:
            self.assertEqual(session.eval("print('x' * 5_000_000)", timeout=PATIENCE).output, "x" * 5_000_000 + "\n")

    def test_warnings(self):
        with self.begin() as session:
            result = session.eval("import warnings\ndef f():\n    warnings.warn('careful', FutureWarning)\nf()",
                                  timeout=PATIENCE)
            warned, = result.warnings
            self.assertEqual(warned[:2], ("FutureWarning", "careful"))
            self.assertEqual([frame[1:] for frame in warned.frames], [("<module>", 4), ("f", 3)])

    def test_displays(self):
        shown = []
        with self.begin(on_display=shown.append) as session:
            session.eval(PICTURES, timeout=PATIENCE)
            result = session.eval("print('before'); Both()", timeout=PATIENCE)
            self.assertEqual((result.output, result.value), ("before\n", "a value"))
            display, = result.displays
            self.assertEqual(display, krutil.Display(1, {"image/png": PNG, "text/html": "<b>zwölf</b>"}))
            self.assertEqual(shown, [display])
            # Of two requests that run before the engine is asked, each has its own.
            requests = [session.submit(code) for code in ("Html()", "1", "Html(); Html(); Html()", "Html(); 1 / 0")]
            self.assertEqual([request.result(PATIENCE).value for request in requests[:3]], ["h", "1", "h"])
            self.assertRaises(krutil.RemoteError, requests[3].result, PATIENCE)
            self.assertEqual([[display.number for display in request.displays] for request in requests], [[2], [], [3], []])

    def test_displays_of_a_request_that_fails(self):
        with self.begin(on_display=lambda display: None) as session:
            session.eval(PICTURES, timeout=PATIENCE)
            request = session.submit("import sys; sys.displayhook(Html()); 1 / 0")
            self.assertRaises(krutil.RemoteError, request.result, PATIENCE)
            self.assertEqual([display.formats for display in request.displays], [{"text/html": "<i>h</i>"}])

    def test_displays_at_a_prompt(self):
        seen = []
        with self.begin(on_display=lambda display: None,
                        on_debug=lambda prompt: seen.append(prompt.eval("Html()", timeout=PATIENCE).displays)) as session:
            session.eval(PICTURES, timeout=PATIENCE)
            outer = session.eval("breakpoint(); Both()", timeout=PATIENCE)
        self.assertEqual([[display.number for display in each] for each in (*seen, outer.displays)], [[1], [2]])

    def test_a_value_that_looks_like_a_display(self):
        code = "class Trick:\n  def __repr__(self): return '[picture 9: image/png, 1 x 1]'\nTrick()"
        for options in {"on_display": lambda display: None}, {}:
            with self.begin(**options) as session:
                result = session.eval(code, timeout=PATIENCE)
                self.assertEqual((result.value, result.displays), ("[picture 9: image/png, 1 x 1]", ()))

    def test_without_on_display_nothing_is_shown(self):
        with self.begin() as session:
            session.eval(PICTURES, timeout=PATIENCE)
            result = session.eval("Both()", timeout=PATIENCE)
            self.assertEqual((result.value, result.displays), ("a value", ()))

    def test_an_error_with_its_cause(self):
        code = "def f():\n    1 / 0\ntry:\n    f()\nexcept ZeroDivisionError as e:\n    raise ValueError('no') from e"
        with self.begin() as session:
            try:
                session.eval(code, timeout=PATIENCE)
                self.fail("there was no error")
            except krutil.RemoteError as caught:
                error = caught
            self.assertEqual((error.identifier, error.message, str(error)), ("ValueError", "no", "ValueError: no"))
            self.assertEqual([frame[1:] for frame in error.frames], [("<module>", 6)])
            cause, = error.causes
            self.assertIs(error.__cause__, cause)
            self.assertEqual([frame[1:] for frame in cause.frames], [("<module>", 4), ("f", 2)])
            self.assertIn("The above exception was the direct cause of the following exception:", error.text)

            file = error.frames[0].file
            printed = "".join(traceback.format_exception(error))
            self.assertTrue(printed.startswith(
                f'Traceback (most recent call last):\n  File "{file}", line 4, in <module>\n'
                f'  File "{file}", line 2, in f\n'
                "krutil.RemoteError: ZeroDivisionError: division by zero\n\n"
                "The above exception was the direct cause of the following exception:\n\n"
                "Traceback (most recent call last):\n"), printed)
            self.assertTrue(printed.endswith(f'  File "{file}", line 6, in <module>\n'
                                             "krutil.RemoteError: ValueError: no\n"), printed)
            self.assertEqual(session.eval("'goes on'", timeout=PATIENCE).value, "'goes on'")

    def test_an_error_cannot_steer_the_terminal_that_it_is_printed_on(self):
        message = "a\x1b[2J\t\x9b\u061c\u200e\u202e\u2066\u2028\n\u05d0"
        source = f"raise ValueError({message!r})"
        code = f"exec(compile({source!r}, 'file\u202e.py', 'exec'))"
        with self.begin() as session:
            with self.assertRaises(krutil.RemoteError) as caught:
                session.eval(code, timeout=PATIENCE)
            self.assertEqual(caught.exception.message, message)
            shown = "ValueError: a\\x1b[2J\t\\x9b\\u061c\\u200e\\u202e\\u2066\\u2028\n\u05d0"
            self.assertEqual(str(caught.exception), shown)
            # assertRaises takes the traceback away; a copy has it again.
            copy = pickle.loads(pickle.dumps(caught.exception))
            printed = "".join(traceback.format_exception(copy))
            self.assertTrue(printed.endswith('  File "file\\u202e.py", line 1, in <module>\n'
                                             f"krutil.RemoteError: {shown}\n"), printed)

    def test_an_error_in_a_file_that_is_here_too(self):
        with tempfile.NamedTemporaryFile("w", suffix=".py") as file:
            file.write("def f():\n    return int('x') + 1\n")
            file.flush()
            with self.begin() as session:
                try:
                    session.eval(f"exec(compile(open({file.name!r}).read(), {file.name!r}, 'exec')); f()", timeout=PATIENCE)
                    self.fail("there was no error")
                except krutil.RemoteError as error:
                    printed = io.StringIO()
                    with contextlib.redirect_stderr(printed):
                        sys.__excepthook__(type(error), error, error.__traceback__)
                    both = "".join(traceback.format_exception(error)), printed.getvalue()
            # Python's two ways to print. No part of a line is marked, because it is not known which.
            for text in both:
                self.assertTrue(text.endswith(
                    f'  File "<eval-1>", line 1, in <module>\n  File "{file.name}", line 2, in f\n'
                    "    return int('x') + 1\n"
                    "krutil.RemoteError: ValueError: invalid literal for int() with base 10: 'x'\n"), text)

    def test_a_file_is_run_as_python_runs_it(self):
        with tempfile.TemporaryDirectory() as directory:
            path = os.path.join(directory, "script.py")
            with open(os.path.join(directory, "sibling.py"), "w", encoding="utf-8") as file:
                file.write("def half(text):\n    return int(text) / 2\n")
            with open(path, "w", encoding="latin-1") as file:
                file.write("# coding: latin-1\nfrom __future__ import annotations\nimport sys, sibling\n"
                           "print('zwölf', __file__, sys.argv)\nsibling.half(sys.argv[1])\n")
            with self.begin() as session:
                words = [path, "7", "it's"]
                result = session.run(*words, timeout=PATIENCE)
                self.assertEqual(result, krutil.Result(f"zwölf {path} {words}\n", None, ()))
                with self.assertRaises(krutil.RemoteError) as caught:
                    session.run(path, "seven", timeout=PATIENCE)
                self.assertEqual(caught.exception.identifier, "ValueError")
                self.assertEqual(caught.exception.frames, (
                    (path, "<module>", 5), (os.path.join(directory, "sibling.py"), "half", 2)))
                with self.assertRaises(FileNotFoundError):
                    session.run(os.path.join(directory, "missing.py"))
                self.assertEqual(session.eval("1 + 1", timeout=PATIENCE).value, "2")

    def test_code_that_does_not_compile(self):
        with self.begin() as session:
            with self.assertRaises(krutil.RemoteError) as caught:
                session.eval("1 +", timeout=PATIENCE)
            self.assertEqual((caught.exception.identifier, caught.exception.frames), ("SyntaxError", ()))

    def test_arrays_of_each_type_there_and_back(self):
        with self.begin() as session:
            for code in "?bBhHiIlLfdFD":
                for size in (0, 1, 3, 5000):
                    sent = numpy.arange(size).astype(code).reshape(1, size)
                    received = session.call("numpy.asarray", sent, timeout=PATIENCE)
                    self.assertEqual((received.dtype, received.shape), (sent.dtype, sent.shape))
                    self.assertTrue((received == sent).all(), (code, size))
                    self.assertTrue(received.flags.writeable)

    def test_memory_orders(self):
        rows = numpy.arange(6000.0).reshape(2, 30, 100)
        columns = numpy.asfortranarray(rows)
        with self.begin() as session:
            for sent in (rows, columns, rows[:, ::2], rows.astype(">f8"), rows[0, 0], numpy.float64(2.5), rows[:, :0]):
                received = session.call("numpy.asarray", sent, timeout=PATIENCE)
                self.assertTrue(numpy.array_equal(received, sent))
            self.assertTrue(session.call("numpy.asarray", columns, timeout=PATIENCE).flags.f_contiguous)

    def test_numbers_and_texts(self):
        with self.begin() as session:
            for sent in (True, 7, -1.5, 2 + 3j, [1, 2], "zwölf 😀", ""):
                received = session.call("numpy.asarray" if not isinstance(sent, str) else "str", sent, timeout=PATIENCE)
                self.assertTrue(numpy.array_equal(received, sent), sent)
            self.assertEqual(session.call("str.upper", "zwölf", timeout=PATIENCE), "ZWÖLF")

    def test_outputs(self):
        a = numpy.random.default_rng(1).random((60, 50))
        with self.begin() as session:
            q, r = session.call("numpy.linalg.qr", a, outputs=2, timeout=PATIENCE)
            self.assertTrue(numpy.allclose(q @ r, a))
            self.assertIsNone(session.call("print", "seen", outputs=0, timeout=PATIENCE))
            with self.assertRaises(krutil.RemoteError) as caught:
                session.call("divmod", 7, 2, outputs=3, timeout=PATIENCE)
            self.assertEqual(caught.exception.identifier, "ValueError")

    def test_arguments_that_cannot_be_sent(self):
        with self.begin() as session:
            for bad in (None, object(), numpy.array(["a"]), numpy.float16(1), numpy.ma.array([1, 2], mask=[0, 1])):
                with self.assertRaises(TypeError):
                    session.submit_call("print", bad)
            for submit, bad, text in (
                    (session.submit_call, numpy.sum, "function: expected the name of a function of the engine, such as "
                                                     "'numpy.linalg.inv'; got function"),
                    (session.submit, 1, "code: expected a str, got int")):
                with self.assertRaises(TypeError) as caught:
                    submit(bad)
                self.assertEqual(str(caught.exception), text)
            self.assertEqual(session.eval("1", timeout=PATIENCE).value, "1")

    def test_large_arrays_are_not_copied(self):
        size = 32 * MiB
        sent = numpy.arange(size // 8)
        with self.begin() as session:
            session.call("numpy.asarray", sent[:1000], timeout=PATIENCE)
            tracemalloc.start()
            self.addCleanup(tracemalloc.stop)
            received = session.call("numpy.asarray", sent, timeout=PATIENCE)
            peak = tracemalloc.get_traced_memory()[1]
            self.assertTrue((received == sent).all())
            if self.zero_copy:
                self.assertLess(peak, size + MiB)
            del received
            self.await_memory_below(MiB)
            # What is only sent takes nothing.
            tracemalloc.reset_peak()
            session.call("len", sent, timeout=PATIENCE)
            if self.zero_copy:
                self.assertLess(tracemalloc.get_traced_memory()[1], MiB)
            self.await_memory_below(MiB)

    def await_memory_below(self, size):
        """The threads of the session may be a moment behind."""
        eventually(lambda: tracemalloc.get_traced_memory()[0] < size, f"memory below {size} bytes")

    def test_many_threads(self):
        with self.begin() as session:
            found = {}

            def ask(number):
                found[number] = [session.eval(f"{number} * {step}", timeout=PATIENCE).value for step in range(20)]

            threads = [threading.Thread(target=ask, args=[number]) for number in range(4)]
            for thread in threads:
                thread.start()
            for thread in threads:
                thread.join()
            self.assertEqual(found, {number: [str(number * step) for step in range(20)] for number in range(4)})

    def test_requests_that_wait_for_each_other(self):
        with self.begin() as session:
            requests = [session.submit(f"x = {number}; x") for number in range(100)]
            self.assertEqual([each.result(PATIENCE).value for each in requests], [str(number) for number in range(100)])

    def test_an_event_of_each_kind(self):
        with self.begin() as session:
            events = list(session.submit("print('a'); 1").events(PATIENCE))
        self.assertEqual(joined((str(event), type(event)) for event in events),
                         [("started", krutil.State), ("a\n", krutil.Text), ("1\n", krutil.Value),
                          ("completedlast", krutil.State)])

    def test_cancel_of_what_runs(self):
        with self.begin() as session:
            request = session.submit("while True: pass")
            self.assertIn("started", (event for event in request.events(PATIENCE) if event == "started"))
            self.assertEqual(request.cancel(even_if_running=False, timeout=PATIENCE), krutil.CancelAnswer.ALREADY_RUNNING)
            self.assertEqual(request.cancel(timeout=PATIENCE), krutil.CancelAnswer.PENDING)
            with self.assertRaises(krutil.Cancelled):
                request.result(PATIENCE)
            self.assertEqual(request.cancel(timeout=PATIENCE), krutil.CancelAnswer.ALREADY_DONE)

    def test_cancel_of_what_waits(self):
        with self.begin() as session:
            first, second = session.submit("while True: pass"), session.submit("1")
            self.assertEqual(second.cancel(timeout=PATIENCE), krutil.CancelAnswer.CANCELLED)
            with self.assertRaises(krutil.Cancelled) as caught:
                second.result(PATIENCE)
            self.assertEqual(str(caught.exception), "The request was cancelled before it was started.")
            first.cancel(timeout=PATIENCE)

    def test_a_timeout_cancels(self):
        with self.begin() as session:
            for options in {}, {"on_text": print}:
                with self.assertRaises(TimeoutError) as caught:
                    session.eval("while True: pass", timeout=0.05, **options)
                self.assertEqual(str(caught.exception), "there is no reply yet")
            self.assertEqual(session.eval("'goes on'", timeout=PATIENCE).value, "'goes on'")

    def test_an_exception_in_on_text_cancels(self):
        def stop(text):
            raise KeyboardInterrupt

        with self.begin() as session:
            with self.assertRaises(KeyboardInterrupt):
                session.eval("print('go', flush=True)\nwhile True: pass", on_text=stop)
            self.assertEqual(session.eval("'goes on'", timeout=PATIENCE).value, "'goes on'")

    def test_an_exception_that_leaves_the_block_cancels_what_is_open(self):
        with self.assertRaises(LookupError):
            with self.begin() as session:
                requests = [session.submit("while True: pass"), session.submit("1")]
                raise LookupError
        for request in requests:
            with self.assertRaises(krutil.Cancelled):
                request.result(PATIENCE)

    def test_close_waits_for_replies(self):
        with self.begin() as session:
            requests = [session.submit("sum(range(10**6))") for _ in range(3)]
        self.assertTrue(all(request.done() for request in requests))
        session.close(PATIENCE)
        with self.assertRaises(krutil.Lost) as caught:
            session.eval("1")
        self.assertEqual(str(caught.exception), "the session is closed")
        with self.assertRaises(krutil.Lost):
            requests[0].cancel()

    def test_code_that_ends_the_session(self):
        with self.begin() as session:
            with self.assertRaises(krutil.RemoteError) as caught:
                session.eval("raise SystemExit(3)", timeout=PATIENCE)
            self.assertEqual(str(caught.exception), "SystemExit: 3")
            self.assertTrue(session._dispatch._ended.wait(PATIENCE))
            with self.assertRaises(krutil.Lost) as lost:
                session.eval("1")
            self.assertEqual(str(lost.exception), "the engine has ended the session")

    def test_an_engine_that_is_lost(self):
        session = self.begin()
        with self.assertRaises(krutil.Lost) as caught:
            session.eval("import os; os._exit(7)", timeout=PATIENCE)
        self.assertEqual(str(caught.exception), self.lost)
        with self.assertRaises(krutil.Lost):
            session.close(PATIENCE)
        session.close(PATIENCE)

    def test_kill(self):
        session = self.begin()
        request = session.submit("while True: pass")
        session.kill()
        with self.assertRaises(krutil.Lost):
            request.result(PATIENCE)
        session.close(PATIENCE)

    def test_limits_of_this_end(self):
        with self.begin(limits=krutil.Limits(tagged_frame=64 * KiB, array_message=64 * KiB, message=64 * KiB)) as session:
            self.assertEqual(session.eval("print('x' * 200_000)", timeout=PATIENCE).output, "x" * 200_000 + "\n")
            with self.assertRaises(krutil.Refused) as caught:
                session.call("numpy.zeros", 100_000, timeout=PATIENCE)
            self.assertRegex(str(caught.exception), "^The result of this request cannot be sent: ")
            self.assertEqual(session.call("numpy.zeros", 3, timeout=PATIENCE).tolist(), [0, 0, 0])

    def test_input(self):
        asked = []

        def answer(text):
            asked.append(text)
            return {"name? ": "Ada", "more? ": ""}.get(text)

        with self.begin(on_input=answer) as session:
            code = "a = input('name? '); b = input('more? ')\ntry: input('end? ')\nexcept EOFError: c = 'end'\na, b, c"
            result = session.eval(code, timeout=PATIENCE)
        self.assertEqual(asked, ["name? ", "more? ", "end? "])
        self.assertEqual((result.value, result.output), ("('Ada', '', 'end')", "name? more? end? "))

    def test_without_on_input_input_is_at_its_end(self):
        with self.begin() as session, self.assertRaises(krutil.RemoteError) as caught:
            session.eval("input()", timeout=PATIENCE)
        self.assertEqual(caught.exception.identifier, "EOFError")

    def test_an_error_in_on_input_is_the_end_of_input(self):
        hook, threading.excepthook = threading.excepthook, lambda arguments: seen.put(arguments.exc_type)
        self.addCleanup(setattr, threading, "excepthook", hook)
        seen = queue.Queue()

        def answer(text):
            if text == "number? ":
                return 7
            raise LookupError

        with self.begin(on_input=answer) as session:
            for prompt, error in (("number? ", TypeError), ("error? ", LookupError)):
                with self.assertRaises(krutil.RemoteError) as caught:
                    session.eval(f"input('{prompt}')", timeout=PATIENCE)
                self.assertEqual(caught.exception.identifier, "EOFError")
                self.assertEqual(seen.get(timeout=PATIENCE), error)

    def test_pause(self):
        asked = []
        with self.begin(on_input=asked.append) as session:
            self.assertEqual(session.eval("import qvm; qvm.pause(); 'over'", timeout=PATIENCE).value, "'over'")
        self.assertEqual(asked, [""])

    def test_breakpoint(self):
        looks = []

        def look(prompt):
            looks.append((prompt.kind, prompt.where.splitlines()[0].partition(" (")[0], prompt.eval("x").value))
            prompt.eval("x = 5")

        with self.begin(on_debug=look) as session:
            result = session.eval("def f(x):\n    breakpoint()\n    return x\nf(2) + f(3)", timeout=PATIENCE)
        self.assertEqual(looks, [("debug", "Stopped in f", "2"), ("debug", "Stopped in f", "3")])
        self.assertEqual(result.value, "10")

    def test_quit_at_a_breakpoint(self):
        with self.begin(on_debug=krutil.Prompt.quit) as session:
            with self.assertRaises(krutil.RemoteError) as caught:
                session.eval("breakpoint()", timeout=PATIENCE)
            self.assertEqual(caught.exception.identifier, "qvm.DebuggerQuit")

    def test_prompts_nest(self):
        def look(prompt):
            self.assertEqual(prompt.eval("input('inner? ')").value, "'line'")
            prompt.go_on()
            with self.assertRaises(RuntimeError):
                prompt.eval("1")

        with self.begin(on_input=lambda text: "line", on_debug=look) as session:
            self.assertEqual(session.eval("import qvm; qvm.keyboard(); 'over'", timeout=PATIENCE).value, "'over'")

    def test_cancel_at_a_prompt(self):
        asked, withdrawn = threading.Event(), queue.Queue()

        def answer(question):
            withdrawn.put(question.withdrawn())
            asked.set()
            withdrawn.put(question.withdrawn(PATIENCE))
            return "too late"

        with self.begin(on_input=answer) as session:
            request = session.submit("input()")
            self.assertTrue(asked.wait(PATIENCE))
            self.assertEqual(request.cancel(timeout=PATIENCE), krutil.CancelAnswer.PENDING)
            with self.assertRaises(krutil.Cancelled):
                request.result(PATIENCE)
            self.assertEqual([withdrawn.get(timeout=PATIENCE) for _ in range(2)], [False, True])
            self.assertEqual(session.eval("'goes on'", timeout=PATIENCE).value, "'goes on'")


class Child(Behaviour):
    """An engine of its own, over a socket pair."""

    lost = "the engine has gone (exit code 7): the stream ended without the engine's last message"

    def setUp(self):
        set_zero_copy(self, self.zero_copy)

    def begin(self, **options):
        return krutil.start(timeout=PATIENCE, **options)


class ChildWithZeroCopy(Child, unittest.TestCase):
    zero_copy = True


class ChildWithoutZeroCopy(Child, unittest.TestCase):
    zero_copy = False


class Connected(Behaviour):
    """A session of an engine that listens."""

    lost = "the engine has gone: the stream ended without the engine's last message"

    @classmethod
    def setUpClass(cls):
        environment = {name: value for name, value in os.environ.items() if name != "QX_DISABLE_ZEROCOPY"}
        if not cls.zero_copy:
            environment["QX_DISABLE_ZEROCOPY"] = "1"
        cls.listener = Listener(environment=environment)

    @classmethod
    def tearDownClass(cls):
        cls.listener.stop()

    def begin(self, **options):
        return krutil.connect(self.listener.path, timeout=PATIENCE, **options)


class ConnectedWithZeroCopy(Connected, unittest.TestCase):
    zero_copy = True


class ConnectedWithoutZeroCopy(Connected, unittest.TestCase):
    """The engine decides: this process has no such variable."""

    zero_copy = False


class StartTest(unittest.TestCase):
    def test_a_program_that_is_not_there(self):
        with self.assertRaises(FileNotFoundError) as caught:
            krutil.start("no-such-engine --stdio")
        self.assertEqual(str(caught.exception), "there is no program 'no-such-engine' to be the engine: put its directory "
                                                "into PATH, or give the command")

    def test_a_program_that_is_no_engine(self):
        with self.assertRaises(krutil.Aborted) as caught:
            krutil.start("echo 'not an engine'", timeout=PATIENCE)
        self.assertEqual(str(caught.exception), "the engine broke the protocol: the peer does not speak this protocol: "
                         'expected a first message that begins with "\\x89KRUTIL\\n", got "not an engine"')

    def test_a_program_that_ends(self):
        with self.assertRaises(krutil.Lost) as caught:
            krutil.start(["true"], timeout=PATIENCE)
        self.assertEqual(str(caught.exception), "the engine has gone (exit code 0) before it said anything")

    def test_a_command_without_words(self):
        for command in "", []:
            with self.assertRaises(ValueError) as caught:
                krutil.start(command)
            self.assertEqual(str(caught.exception), "command: expected the words that run an engine, got none")

    def test_nothing_listens(self):
        with tempfile.TemporaryDirectory() as directory:
            path = os.path.join(directory, "engine")
            with self.assertRaises(FileNotFoundError) as caught:
                krutil.connect(path)
            self.assertEqual(str(caught.exception),
                             f"[Errno 2] no engine can be reached there: No such file or directory: '{path}'")
            with self.assertRaises(OSError) as caught:
                krutil.connect(path + "e" * 200)
            self.assertEqual(str(caught.exception),
                             f"[Errno 36] no engine can be reached there: AF_UNIX path too long: '{path}{'e' * 200}'")

    @unittest.skipUnless(os.geteuid() == 0, "needs to become another user")
    def test_an_engine_of_another_user(self):
        with tempfile.TemporaryDirectory() as directory, socket.socket(socket.AF_UNIX) as listening:
            path = os.path.join(directory, "engine")
            listening.bind(path)
            os.seteuid(65534)
            try:
                listening.listen()
            finally:
                os.seteuid(0)
            with self.assertRaises(krutil.Refused) as caught:
                krutil.connect(path)
            self.assertEqual(str(caught.exception), f"cannot connect to '{path}': the engine there runs as user 65534, not "
                                                    f"as user 0 as this program does")
            accepted, _ = listening.accept()
            with accepted:
                self.assertEqual(accepted.recv(1), b"")

    @unittest.skipUnless(os.geteuid() == 0, "needs to become another user")
    def test_a_socket_of_the_service_manager(self):
        with tempfile.TemporaryDirectory() as directory, socket.socket(socket.AF_UNIX) as listening:
            path = os.path.join(directory, "engine")
            listening.bind(path)
            listening.listen()
            os.chmod(path, 0o666)
            os.chmod(directory, 0o711)
            os.seteuid(65534)
            try:
                # So it was connected to: nobody answers.
                with self.assertRaises(krutil.Lost) as caught:
                    krutil.connect(path, timeout=0.1)
            finally:
                os.seteuid(0)
            self.assertEqual(str(caught.exception), "the engine did not finish the handshake within 0.1 seconds")

    def test_ends_that_do_not_agree_on_zero_copy(self):
        set_zero_copy(self, False)
        command = "env --unset=QX_DISABLE_ZEROCOPY krutil-qvm --stdio"
        with self.assertRaises(krutil.Refused):
            krutil.start(command, timeout=PATIENCE)

    def test_limits_of_the_engine(self):
        options = "--limit-tagged-frame 64KiB --limit-message 1MiB --limit-frames 8"
        with krutil.start(f"krutil-qvm --stdio {options}", timeout=PATIENCE) as session:
            for refused, text in (
                    (lambda: session.submit("#" * 70_000),
                     r'^a part of the request \("krutil:EvalIIP"\) has 70\d\d\d bytes; the engine accepts 65536 \(its limit '
                     r'"taggedFrame"\)$'),
                    (lambda: session.submit_call("len", numpy.zeros(MiB)),
                     r'^the request has 838\d\d\d\d bytes; the engine accepts 1048576 \(its limit "message"\)$'),
                    (lambda: session.submit_call("print", *range(7)),
                     r'^the request has 9 frames; the engine accepts 8 \(its limit "frames"\)$')):
                with self.assertRaisesRegex(ValueError, text):
                    refused()
            self.assertEqual(session.eval("1", timeout=PATIENCE).value, "1")
        with krutil.start("krutil-qvm --stdio --limit-parts 8", timeout=PATIENCE) as session:
            with self.assertRaises(ValueError) as caught:
                session.submit_call("max", 1, 2)
            self.assertEqual(str(caught.exception), 'a part of the request ("krutil:FEvalIIP") has more than 8 fields, which is '
                                                    'what the engine accepts (its limit "parts")')
            self.assertEqual(session.eval("1", timeout=PATIENCE).value, "1")

    def test_a_recording_is_an_engine(self):
        numbers = numpy.arange(1000.0)
        with tempfile.TemporaryDirectory() as directory:
            file = os.path.join(directory, "session.pcapng")
            sums, reports = [], []
            for command in (f"krutil-qvm --stdio --record {file}", f"krutil replay {file} --serve"):
                # The engine's standard error is this process's own, so that of a shell around it goes to a file.
                report = os.path.join(directory, "report")
                with krutil.start(["sh", "-c", f"{command} 2> {report}"], timeout=PATIENCE) as session:
                    self.assertEqual(session.eval("6 * 7", timeout=PATIENCE).value, "42")
                    with self.assertRaises(krutil.RemoteError):
                        session.eval("1 / 0", timeout=PATIENCE)
                    sums.append(session.call("numpy.add", numbers, numbers, timeout=PATIENCE))
                with open(report, encoding="utf-8") as lines:
                    reports.append(lines.read())
        numpy.testing.assert_array_equal(sums[1], 2 * numbers)
        self.assertEqual(reports[1], "4 of 4 messages of the client as in the recording\n")

    def test_a_full_queue(self):
        with krutil.start("krutil-qvm --stdio --max-queued 1", timeout=PATIENCE) as session:
            first = session.submit("while True: pass")
            self.assertIn("started", (event for event in first.events(PATIENCE) if event == "started"))
            second, third = session.submit("2"), session.submit("3")
            with self.assertRaises(krutil.Refused):
                third.result(PATIENCE)
            first.cancel(timeout=PATIENCE)
            self.assertEqual(second.result(PATIENCE).value, "2")

    def test_text_of_no_request(self):
        texts, came = [], threading.Event()

        def on_text(text):
            texts.append((str(text), text.stream))
            came.set()

        with krutil.start(on_text=on_text, timeout=PATIENCE) as session:
            # The pipe is written to when its request has ended: the engine has said so by its reply.
            session.eval("import os, threading\nr, w = os.pipe()\n"
                         "threading.Thread(target=lambda: os.write(1, os.read(r, 9))).start()", timeout=PATIENCE)
            path = session.eval("f'/proc/{os.getpid()}/fd/{w}'", timeout=PATIENCE).value.strip("'")
            with open(path, "wb", buffering=0) as pipe:
                pipe.write(b"later")
            self.assertTrue(came.wait(PATIENCE))
        self.assertEqual(texts, [("later", "background")])

    def test_an_engine_of_ours_does_not_hear_of_ctrl_c(self):
        code = "int([line for line in open('/proc/self/status') if line.startswith('SigIgn')][0].split()[1], 16) >> 1 & 1"
        with krutil.start(timeout=PATIENCE) as session:
            self.assertEqual(session.eval(code, timeout=PATIENCE).value, "1")

    def test_ctrl_c(self):
        code = ("import krutil\n"
                "with krutil.start(timeout=120) as session:\n"
                "    try:\n"
                "        session.eval('print(1, flush=True)\\nwhile True: pass', on_text=lambda _: print('go', flush=True))\n"
                "    except KeyboardInterrupt:\n"
                "        print(session.eval('\"goes on\"').value)\n")
        program = subprocess.Popen([sys.executable, "-c", code], stdout=subprocess.PIPE, text=True, start_new_session=True)
        self.assertEqual(program.stdout.readline(), "go\n")
        # To both, as a terminal does.
        os.killpg(program.pid, signal.SIGINT)
        self.assertEqual(program.communicate(timeout=PATIENCE)[0], "'goes on'\n")
        self.assertEqual(program.returncode, 0)


def set_zero_copy(test, enabled):
    before = os.environ.pop("QX_DISABLE_ZEROCOPY", None)
    if not enabled:
        os.environ["QX_DISABLE_ZEROCOPY"] = "1"

    def restore():
        os.environ.pop("QX_DISABLE_ZEROCOPY", None)
        if before is not None:
            os.environ["QX_DISABLE_ZEROCOPY"] = before

    test.addCleanup(restore)


if __name__ == "__main__":
    unittest.main()
