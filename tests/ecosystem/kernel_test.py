"""The notebook kernel, as the real jupyter_client and nbclient see it."""

import base64
import io
import json
import os
import queue
import re
import signal
import subprocess
import sys
import time
import unittest

import matplotlib.image
import nbformat
from jupyter_client.manager import KernelManager
from jupyter_client.kernelspec import KernelSpecManager
from nbclient import NotebookClient
from nbclient.exceptions import CellExecutionError

import jupyter
from eventually import PATIENCE, eventually

COLOURS = re.compile(r"\x1b\[[0-9;]*m")


class Cell:
    """What came of one execute request, in order: replies to it, and what was published because of it."""

    def __init__(self, client, code, on_input=None, on_running=None, **options):
        self.published = []
        self.asked = []
        identifier = client.execute(code, allow_stdin=on_input is not None, **options)
        end = time.monotonic() + PATIENCE
        while True:
            if on_input is not None:
                try:
                    question = client.get_stdin_msg(timeout=0.02)["content"]["prompt"]
                    self.asked.append(question)
                    answer = on_input(question)
                    if answer is not None:
                        client.input(answer)
                except queue.Empty:
                    pass
            try:
                message = client.get_iopub_msg(timeout=0.02 if on_input is not None else PATIENCE)
            except queue.Empty:
                assert time.monotonic() < end, self.published
                continue
            if message["parent_header"].get("msg_id") != identifier:
                continue
            kind, content = message["msg_type"], message["content"]
            if kind == "status" and content["execution_state"] == "idle":
                break
            self.published.append((kind, content))
            if on_running is not None and kind == "stream":
                on_running()
                on_running = None
        while True:
            message = client.get_shell_msg(timeout=PATIENCE)
            if message["parent_header"].get("msg_id") == identifier:
                self.reply = message["content"]
                return

    def text(self, name):
        return "".join(content["text"] for kind, content in self.published if kind == "stream" and content["name"] == name)

    def of(self, kind):
        return [content for its_kind, content in self.published if its_kind == kind]

    @property
    def value(self):
        value, = self.of("execute_result")
        return value["data"]["text/plain"]


class WithKernel(unittest.TestCase):
    """`cls.begin()` starts a kernel; `cls.connect()` makes a client of it."""

    @classmethod
    def setUpClass(cls):
        cls.directory = jupyter.install(cls)

    @classmethod
    def begin(cls):
        cls.manager = KernelManager(kernel_name="krutil")
        cls.manager.start_kernel(cwd=cls.directory)
        cls.connect()

    @classmethod
    def connect(cls):
        cls.client = cls.manager.client()
        cls.client.start_channels()
        cls.client.wait_for_ready(timeout=PATIENCE)

    @classmethod
    def end(cls):
        cls.client.stop_channels()
        if cls.manager.is_alive():
            cls.manager.shutdown_kernel(now=True)

    def run_cell(self, code, **options):
        return Cell(self.client, code, **options)


class CellsTest(WithKernel):
    """All of these with one kernel, which each of them leaves as it finds it."""

    @classmethod
    def setUpClass(cls):
        super().setUpClass()
        cls.begin()
        cls.addClassCleanup(cls.end)

    def answer(self, identifier):
        while True:
            message = self.client.get_shell_msg(timeout=PATIENCE)
            if message["parent_header"].get("msg_id") == identifier:
                return message["content"]

    def test_what_it_says_of_itself(self):
        info = self.answer(self.client.kernel_info())
        self.assertEqual((info["implementation"], info["language_info"]["name"], info["language_info"]["file_extension"]),
                         ("krutil", "python", ".py"))

    def test_output_and_values(self):
        cell = self.run_cell("import sys\nprint('one')\nprint('two', file=sys.stderr)\n6 * 7")
        self.assertEqual((cell.text("stdout"), cell.text("stderr"), cell.value), ("one\n", "two\n", "42"))
        self.assertEqual(cell.of("execute_result")[0]["execution_count"], cell.reply["execution_count"])
        self.assertEqual(cell.reply["status"], "ok")
        self.assertEqual(self.run_cell("x = 5").of("execute_result"), [])
        self.assertEqual(self.run_cell("x + 1").value, "6")
        self.assertEqual(self.run_cell("x + 1; ").of("execute_result"), [])
        self.assertEqual(self.run_cell("print('a' * 3_000_000)").text("stdout"), "a" * 3_000_000 + "\n")

    def test_the_language_process_is_the_engine(self):
        name = self.run_cell("import os\nos.readlink('/proc/self/exe')").value
        self.assertEqual(os.path.basename(name.strip("'")), "krutil-qvm")
        self.assertEqual(self.run_cell("os.getcwd()").value, repr(self.directory))

    def test_silent_cells_and_expressions(self):
        cell = self.run_cell("y = 1; print(y)\ny", silent=True)
        self.assertEqual(cell.published, [("status", {"execution_state": "busy"})])
        cell = self.run_cell("", user_expressions={"good": "y + 1", "bad": "1 / 0"})
        self.assertEqual(cell.reply["user_expressions"]["good"],
                         {"status": "ok", "data": {"text/plain": "2"}, "metadata": {}})
        self.assertEqual(cell.reply["user_expressions"]["bad"]["ename"], "ZeroDivisionError")

    def test_a_plot(self):
        cell = self.run_cell("import matplotlib.pyplot as plt\nprint('before')\nplt.plot([1, 2])\nplt.show()\n"
                             "print('after')")
        kinds = [kind for kind, _ in cell.published if kind not in ("status", "execute_input")]
        self.assertEqual(kinds, ["stream", "display_data", "stream", "update_display_data"])
        place, picture = cell.of("display_data")[0], cell.of("update_display_data")[0]
        self.assertEqual(place["transient"], picture["transient"])
        self.assertRegex(place["data"]["text/plain"], r"\A\[picture [0-9]+: image/png, 640 x 480\]\Z")
        self.assertEqual(list(picture["data"]), ["image/png"])
        self.assertTrue(base64.b64decode(picture["data"]["image/png"]).startswith(b"\x89PNG"))

    def test_a_value_with_html(self):
        cell = self.run_cell("class Red:\n    def __repr__(self): return 'red'\n"
                             "    def _repr_html_(self): return '<b>red</b>'\nRed()")
        self.assertEqual([content["data"] for content in cell.of("execute_result")],
                         [{"text/plain": "red", "text/html": "<b>red</b>"}])
        self.assertEqual(cell.of("display_data"), [])

    def test_a_figure_behind_a_value(self):
        cell = self.run_cell("import matplotlib.pyplot as plt\nlen(plt.plot([1, 2]))")
        self.assertEqual(cell.value, "1")
        self.assertEqual(list(cell.of("execute_result")[0]["data"]), ["text/plain"])
        self.assertEqual([list(content["data"]) for content in cell.of("update_display_data")], [["image/png"]])

    def test_completion(self):
        self.run_cell("zwölf_monate = 12")
        code = "'😀'; 1 + zwölf_m"
        answer = self.answer(self.client.complete(code, len(code)))
        self.assertEqual((answer["status"], answer["matches"], answer["cursor_start"], answer["cursor_end"]),
                         ("ok", ["zwölf_monate"], len(code) - 7, len(code)))
        answer = self.answer(self.client.complete("nothing_of_this_name", 20))
        self.assertEqual((answer["status"], answer["matches"]), ("ok", []))

    def test_inspection(self):
        self.run_cell("def area(radius):\n    'Of a circle.'\n    return 3 * radius ** 2")
        answer = self.answer(self.client.inspect("1 + area(2)", 7))
        self.assertEqual((answer["status"], answer["found"]), ("ok", True))
        self.assertIn("area(radius)", answer["data"]["text/plain"])
        self.assertIn("Of a circle.", answer["data"]["text/plain"])
        answer = self.answer(self.client.inspect("nothing_of_this_name", 20))
        self.assertEqual((answer["status"], answer["found"], answer["data"]), ("ok", False, {}))

    def test_is_complete(self):
        self.assertEqual([self.answer(self.client.is_complete(code)) for code in ("1 + 1", "for n in x:", "1 +* 1")],
                         [{"status": "complete"}, {"status": "incomplete", "indent": "    "}, {"status": "invalid"}])

    def test_display_shows_values_where_the_code_is(self):
        cell = self.run_cell("class Red:\n"
                             "    def __init__(self, text): self.text = text\n"
                             "    def _repr_html_(self): return f'<b>{self.text}</b>'\n"
                             "for each in 'one', 'two':\n"
                             "    display(Red(each), each)\n"
                             "6 * 7")
        kinds = [kind for kind, _ in cell.published if kind not in ("status", "execute_input")]
        self.assertEqual(kinds[:4], ["display_data", "stream", "display_data", "stream"])
        self.assertEqual(cell.text("stdout"), "'one'\n'two'\n")
        self.assertEqual([content["data"] for content in cell.of("update_display_data")],
                         [{"text/html": "<b>one</b>"}, {"text/html": "<b>two</b>"}])
        self.assertEqual(cell.value, "42")

    def test_display_shows_a_figure_as_it_is_now(self):
        cell = self.run_cell("import matplotlib.pyplot as plt\nfigure, axes = plt.subplots()\n"
                             "display(figure)\naxes.plot([1, 4, 9])\ndisplay(figure)\nplt.close(figure)")
        before, after = (content["data"]["image/png"] for content in cell.of("update_display_data"))
        self.assertNotEqual(before, after)
        self.assertEqual(matplotlib.image.imread(io.BytesIO(base64.b64decode(after))).shape, (480, 640, 4))
        self.assertEqual((cell.text("stdout"), cell.text("stderr")), ("", ""))

    def test_names_that_hide_the_module_of_the_engine(self):
        self.run_cell("qvm = 5; answer_of_all = 42")
        self.assertEqual(self.answer(self.client.complete("answer_of_a", 11))["matches"], ["answer_of_all"])
        self.run_cell("del qvm")

    def test_errors_have_colours(self):
        cell = self.run_cell("def f():\n    return 1 / 0\ntry:\n    f()\nexcept ZeroDivisionError as e:\n"
                             "    raise ValueError('no') from e")
        error, = cell.of("error")
        self.assertEqual((error["ename"], error["evalue"]), ("ValueError", "no"))
        self.assertEqual((cell.reply["status"], cell.reply["traceback"]), ("error", error["traceback"]))
        text = re.sub("<eval-[0-9]+>", "<cell>", "\n".join(error["traceback"]))
        self.assertIn('File \x1b[0;32m"<cell>"\x1b[0m, line \x1b[0;32m2\x1b[0m, in \x1b[0;36mf\x1b[0m\n'
                      "    return 1 / 0\n", text)
        self.assertIn("\n\x1b[0;31mZeroDivisionError\x1b[0m: division by zero\n", text)
        self.assertTrue(text.endswith("\n\x1b[0;31mValueError\x1b[0m: no"), text)
        self.assertTrue(COLOURS.sub("", text).startswith("Traceback (most recent call last):\n"), text)
        self.assertEqual(self.run_cell("'goes on'").value, "'goes on'")

    def test_code_that_does_not_compile(self):
        error, = self.run_cell("1 +").of("error")
        self.assertEqual(error["ename"], "SyntaxError")
        self.assertRegex(error["evalue"], r"\Ainvalid syntax \(<eval-[0-9]+>, line 1\)\Z")

    def test_commands_of_other_kernels(self):
        percent = ["Lines are Python. There are no commands that begin with %."]
        for code, hint in (("%matplotlib inline", percent), ("%%time\n1 + 1", percent),
                           ('x = 1\n! ls -l "a b" \n', [
                               "Lines are Python. This runs a command where the engine is:",
                               '    import subprocess; subprocess.run("ls -l \\"a b\\"", shell=True)']),
                           ("1 +\n'%'", []), ('"""\n%d\n""" % "x"', [])):
            cell = self.run_cell(code)
            error, = cell.of("error")
            lines = [COLOURS.sub("", line) for line in error["traceback"]]
            last = max(i for i, line in enumerate(lines) if re.match("(Syntax|Type)Error: ", line))
            self.assertEqual((lines[last + 1:], cell.reply["traceback"]), (hint, error["traceback"]))

    def test_columns_of_a_frame(self):
        self.run_cell("import pandas\nframe = pandas.DataFrame({'depth': [1], 'two words': [2], 7: [3]})")
        for code, word, matches in (("frame.dep", "dep", ["depth"]), ("frame.descr", "descr", ["describe"]),
                                    ("frame['", "'", ["'depth'", "'two words'"]), ("frame['t", "'t", ["'two words'"])):
            answer = self.answer(self.client.complete(code, len(code)))
            self.assertEqual((answer["matches"], answer["cursor_start"]), (matches, len(code) - len(word)), code)

    def test_warnings(self):
        cell = self.run_cell("import warnings\nwarnings.warn('careful', FutureWarning)")
        self.assertRegex(cell.text("stderr"), r"\A<eval-[0-9]+>:2: FutureWarning: careful\n\Z")

    def test_input(self):
        cell = self.run_cell("first = input('one? '); second = input('two? '); (first, second)",
                             on_input=lambda question: {"one? ": "eins", "two? ": ""}[question])
        self.assertEqual((cell.asked, cell.value), (["one? ", "two? "], "('eins', '')"))

    def test_input_where_nobody_can_be_asked(self):
        error, = self.run_cell("input('one? ')").of("error")
        self.assertEqual((error["ename"], error["evalue"]), ("EOFError", "EOF when reading a line"))

    def test_an_interrupt_is_a_cancel(self):
        cell = self.run_cell("z = 1\nprint('runs')\nwhile True: pass", on_running=self.manager.interrupt_kernel)
        error, = cell.of("error")
        self.assertEqual((error["ename"], error["evalue"]),
                         ("KeyboardInterrupt", "the cell was interrupted; what it has done so far stays"))
        self.assertEqual(self.run_cell("z").value, "1")

    def test_an_interrupt_that_the_code_takes(self):
        cell = self.run_cell("try:\n    print('runs')\n    while True: pass\nexcept KeyboardInterrupt:\n    pass\n'taken'",
                             on_running=self.manager.interrupt_kernel)
        self.assertEqual((cell.value, cell.text("stderr")),
                         ("'taken'", "The interrupt had no effect: the code has caught it, or was done before.\n"))

    def test_an_interrupt_takes_a_question_back(self):
        def interrupt(question):
            self.manager.interrupt_kernel()

        cell = self.run_cell("input('one? ')", on_input=interrupt)
        self.assertEqual((cell.asked, [error["ename"] for error in cell.of("error")]), (["one? "], ["KeyboardInterrupt"]))
        # The answer comes when nobody waits for it any more; it answers no later question.
        self.client.input("late")
        self.assertEqual(self.run_cell("input('two? ')", on_input=lambda question: "in time").value, "'in time'")

    def test_an_interrupt_while_nothing_runs(self):
        # The manager does not wait for the answer, and a cell that follows at once would be interrupted.
        self.client.control_channel.send(self.client.session.msg("interrupt_request", {}))
        self.assertEqual(self.client.get_control_msg(timeout=PATIENCE)["content"], {"status": "ok"})
        self.assertEqual(self.run_cell("1 + 1").value, "2")

    def test_text_of_child_processes(self):
        self.assertEqual(self.run_cell("import os\nos.system('echo from a child') and None").text("stdout"),
                         "from a child\n")


class EndsTest(WithKernel):
    """Each of these with a kernel of its own."""

    def setUp(self):
        self.begin()
        self.addCleanup(self.end)

    def test_a_restart_begins_anew(self):
        before = self.run_cell("import os; a = 1; os.getpid()").value
        self.client.stop_channels()
        self.manager.restart_kernel()
        self.connect()
        error, = self.run_cell("a").of("error")
        self.assertEqual(error["ename"], "NameError")
        self.assertNotEqual(self.run_cell("import os; os.getpid()").value, before)
        self.assert_gone(int(before))

    def test_a_shutdown_runs_exit_functions(self):
        path = os.path.join(self.directory, "left")
        self.run_cell(f"import atexit; atexit.register(lambda: open({path!r}, 'w').write('left'))")
        self.manager.shutdown_kernel()
        with open(path, encoding="utf-8") as file:
            self.assertEqual(file.read(), "left")

    def test_a_shutdown_ends_what_runs(self):
        pid = int(self.run_cell("import os; os.getpid()").value)
        self.client.execute("while True: pass")
        self.manager.shutdown_kernel()
        self.assert_gone(pid)

    def test_a_kernel_that_is_killed_takes_its_engine_along(self):
        pid = int(self.run_cell("import os; os.getpid()").value)
        self.client.execute("while True: pass")
        os.kill(self.manager.provisioner.pid, signal.SIGKILL)
        self.assert_gone(pid)

    def test_an_engine_that_is_lost(self):
        error, = self.run_cell("import os, signal; b = 1; os.kill(os.getpid(), signal.SIGKILL)").of("error")
        self.assertEqual(error["ename"], "Lost")
        self.assertTrue(error["evalue"].startswith("the engine has gone (killed by signal 9): "), error["evalue"])
        self.assertTrue(error["evalue"].endswith(". All its names are lost; the next cell begins with a new engine"))
        error, = self.run_cell("b").of("error")
        self.assertEqual(error["ename"], "NameError")

    def test_a_cell_that_ends_its_engine(self):
        self.assertEqual(self.run_cell("c = 1\nexit()").reply["status"], "ok")
        error, = self.run_cell("c").of("error")
        self.assertEqual((error["ename"], error["evalue"]),
                         ("Lost", "the engine has ended the session. All its names are lost; the next cell begins with a "
                                  "new engine"))
        self.assertEqual(self.run_cell("6 * 7").value, "42")

    def assert_gone(self, pid):
        eventually(lambda: not os.path.exists(f"/proc/{pid}"), f"the end of process {pid}")


class NotebookTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        jupyter.install(cls)

    def test_a_notebook(self):
        notebook = nbformat.v4.new_notebook(cells=[nbformat.v4.new_code_cell(code) for code in (
            "import numpy", "a = numpy.arange(6.0).reshape(2, 3)\nprint(a.sum())", "a.T.shape")])
        NotebookClient(notebook, kernel_name="krutil", timeout=PATIENCE).execute()
        self.assertEqual(notebook.cells[1].outputs, [{"output_type": "stream", "name": "stdout", "text": "15.0\n"}])
        self.assertEqual(notebook.cells[2].outputs[0]["data"], {"text/plain": "(3, 2)"})
        self.assertEqual(notebook.metadata["language_info"]["name"], "python")

    def test_a_notebook_that_plots(self):
        notebook = nbformat.v4.new_notebook(cells=[nbformat.v4.new_code_cell(
            "import matplotlib.pyplot as plt\nfigure = plt.figure(figsize=(2, 1), dpi=100, facecolor='red')")])
        NotebookClient(notebook, kernel_name="krutil", timeout=PATIENCE).execute()
        outputs = notebook.cells[0].outputs
        self.assertEqual(outputs[-1].output_type, "display_data")
        picture = matplotlib.image.imread(io.BytesIO(base64.b64decode(outputs[-1].data["image/png"])))
        self.assertEqual(picture.shape, (100, 200, 4))
        self.assertEqual(picture[50, 100].tolist(), [1, 0, 0, 1])

    def test_a_notebook_that_fails(self):
        notebook = nbformat.v4.new_notebook(cells=[nbformat.v4.new_code_cell(code) for code in ("1 / 0", "2")])
        with self.assertRaises(CellExecutionError) as caught:
            NotebookClient(notebook, kernel_name="krutil", timeout=PATIENCE).execute()
        self.assertEqual((caught.exception.ename, caught.exception.evalue), ("ZeroDivisionError", "division by zero"))
        self.assertEqual(notebook.cells[1].outputs, [])


class InstallTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.directory = jupyter.install(cls)

    def install(self, *arguments, **environment):
        return subprocess.run([sys.executable, "-m", "krutil.kernel", "install", *arguments], env={**os.environ, **environment},
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)

    def words(self, name):
        with open(os.path.join(KernelSpecManager().get_kernel_spec(name).resource_dir, "kernel.json"),
                  encoding="utf-8") as file:
            return json.load(file)

    def test_for_this_user(self):
        done = self.install("--name", "far", "--display-name", "Far away", "--engine", "ssh far krutil-qvm --stdio")
        self.assertEqual(done.stdout,
                         f"The kernel 'far' is in {os.environ['JUPYTER_DATA_DIR']}/kernels/far\n", done.stderr)
        spec = self.words("far")
        self.assertEqual((spec["display_name"], spec["language"], spec["interrupt_mode"], spec["argv"][5:]),
                         ("Far away", "python", "message",
                          ["--engine", "ssh far krutil-qvm --stdio", "-f", "{connection_file}"]))

    def test_a_virtual_environment_that_is_active(self):
        self.assertEqual(self.install("--name", "mine", VIRTUAL_ENV=self.directory).returncode, 0)
        engine = self.words("mine")["argv"][6]
        self.assertTrue(engine.endswith(f"/krutil-qvm --stdio --python {self.directory}/bin/python3"), engine)

    def test_without_an_engine(self):
        done = self.install(PATH="/usr/sbin")
        self.assertEqual((done.returncode, done.stderr.splitlines()[-1]),
                         (2, "python3 -m krutil.kernel install: error: there is no program krutil-qvm: put its directory "
                             "into PATH, or give --engine COMMAND"))

    def test_without_ipykernel(self):
        done = subprocess.run([sys.executable, "-c", "import sys; sys.modules['ipykernel'] = None\n"
                                                     "import krutil.kernel; krutil.kernel.main()"],
                              stderr=subprocess.PIPE, text=True)
        self.assertEqual((done.returncode, done.stderr),
                         (1, "krutil.kernel: a notebook kernel needs ipykernel, which is not installed: "
                             "apt-get install python3-ipykernel\n"))


if __name__ == "__main__":
    unittest.main()
