"""krutil inspect --html: the page that it makes of a recording. tests/ecosystem has it shown by a browser.

    inspect_page_test.py PAGE KRUTIL [TEST...]

PAGE is the page's source.
"""

import base64
import hashlib
import html.parser
import os
import stat
import struct
import subprocess
import sys
import tempfile
import unittest

from recorded_session import GOODBYE, SHUTDOWN, field, frame, recorded, reply, request, text

SOURCE, KRUTIL = sys.argv[1:3]
PATIENCE = 100
HOSTILE = "</script><img src=x onerror=\"alert(1)\"><!--messages-->&amp;'"
# As inspect prints it, without the quotes around it.
SHOWN = HOSTILE.replace('"', '\\"')
VOID = {"meta", "br", "img", "link"}


class Page(html.parser.HTMLParser):
    """What a page says."""

    def __init__(self, source):
        super().__init__()
        self.elements = []  # names and attributes, in order
        self.open = []
        self.rows = {}      # of the tables' bodies, by the identifier of the table
        self.lanes = []     # of messages
        self.notes = []
        self.scripts = []
        self.styles = []
        self.title = self.heading = ""
        self.table = None
        self.feed(source)
        self.close()
        assert self.open == [], self.open

    def handle_starttag(self, name, attributes):
        self.elements.append((name, dict(attributes)))
        if name not in VOID:
            self.open.append(name)
        if name == "table":
            self.table = self.rows.setdefault(dict(attributes)["id"], [])
        elif name == "tr" and "tbody" in self.open:
            self.table.append([])
            self.lanes.extend(int(value) for key, value in attributes if key == "data-lane")
        elif name == "td":
            self.table[-1].append("")
        elif name == "p" and ("class", "note") in attributes and "noscript" not in self.open:
            self.notes.append("")

    def handle_endtag(self, name):
        assert self.open.pop() == name, name

    def handle_data(self, data):
        within = self.open[-1] if self.open else ""
        if within == "td":
            self.table[-1][-1] += data
        elif within == "p" and "noscript" not in self.open and "main" not in self.open:
            self.notes[-1] += data
        elif within in ("script", "style"):
            (self.scripts if within == "script" else self.styles).append(data)
        elif within == "title":
            self.title += data
        elif "h1" in self.open:
            self.heading += data


def unit_size(units):
    return str(sum(map(len, units)))


class InspectPageTest(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name
        self.file = os.path.join(self.directory, "session.pcapng")
        self.out = os.path.join(self.directory, "session.html")

    def write(self, recording):
        with open(self.file, "wb") as file:
            file.write(recording if isinstance(recording, bytes) else recording.bytes())

    def inspect(self, *options, exit_code=0, file=None):
        """What is on standard output and standard error."""
        done = subprocess.run([KRUTIL, "inspect", *options, file or self.file], stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, encoding="utf-8", timeout=PATIENCE,
                              check=False)
        self.assertEqual(done.returncode, exit_code, done.stdout[:1000] + done.stderr)
        return done.stdout, done.stderr

    def page(self, *options, said="", **rest):
        """The page that is made with these options, with nothing else said."""
        self.assertEqual(self.inspect("--html", self.out, *options, **rest), ("", said))
        with open(self.out, encoding="utf-8") as file:
            page = Page(file.read())
        os.unlink(self.out)
        return page

    def test_has_requests_and_messages(self):
        failed = field(1, 2) + field(2, b"ValueError") + field(3, b"no")
        units = (">", request(1, b"first()")), ("<", text(1, b"1\n")), (">", request(2, b"second()", 7)), \
            ("<", reply(2, failed)), ("<", reply(1)), (">", request(3, b"never()", 8)), (">", GOODBYE), ("<", SHUTDOWN)
        self.write(recorded(*units))
        page = self.page()
        first, second, third = "0" * 26 + "abcdef", "0" * 31 + "7", "0" * 31 + "8"
        shown = [line.split() for line in self.inspect()[0].splitlines()[1:]]
        size = [line[line.index("bytes:" if "bytes:" in line else "bytes") - 1] for line in shown]
        self.assertEqual(page.rows["messages"], [
            ["0.000000", "client", "", "hello", "", size[0], '"test\\x1b[31m"'],
            ["0.000001", "engine", "", "hello", "", size[1], '"test\\x1b[31m"'],
            ["0.000002", "client", "", "verdict", "", size[2], "accepted"],
            ["0.000003", "engine", "", "verdict", "", size[3], "accepted"],
            ["0.000004", "client", "00000000", "IIPEnqueueMessage", "0.000000", size[4], 'eval "first()"'],
            ["0.000006", "engine", "00000000", "TextBaseEvent", "0.000002", size[5], 'output "1\\n"'],
            ["0.000007", "client", "00000000", "IIPEnqueueMessage", "0.000000", size[6], 'eval "second()"'],
            ["0.000009", "engine", "00000000", "IIPReply", "0.000002", size[7], 'error "ValueError": "no"'],
            ["0.000011", "engine", "00000000", "IIPReply", "0.000007", size[8], "ok"],
            ["0.000013", "client", "00000000", "IIPEnqueueMessage", "0.000000", size[9], 'eval "never()"'],
            ["0.000015", "client", "", "goodbye", "", size[10], ""],
            ["0.000016", "engine", "", "QVMShutdownEvent", "", size[11], ""]])
        self.assertEqual(page.lanes, [0, 0, 0, 0, 1, 1, 2, 2, 1, 3, 0, 0])
        def total(*numbers):
            return str(sum(int(size[number]) for number in numbers))
        self.assertEqual(page.rows["requests"], [
            ["session 0", "0", "", "", "6", total(0, 1, 2, 3, 10, 11), "", 'recorded by "client 4711", ""'],
            [first, "0", "0.000004", "0.000007", "3", total(4, 5, 8), "ok", 'eval "first()"'],
            [second, "0", "0.000007", "0.000002", "2", total(6, 7), 'error "ValueError": "no"', 'eval "second()"'],
            [third, "0", "0.000013", "", "1", size[9], "no reply", 'eval "never()"']])
        self.assertEqual((page.title, page.heading, page.notes), (f'Recording "{self.file}"',) * 2 + ([],))

    def test_needs_nothing_else_and_runs_only_its_own_code(self):
        self.write(recorded((">", request())))
        page = self.page()
        for name, attributes in page.elements:
            self.assertNotIn(name, ("link", "img", "iframe", "object", "embed", "base", "form", "svg", "a"))
            for attribute in attributes:
                self.assertNotRegex(attribute, "^(on.*|src|href|style|action|background)$")
        def source(content):
            return "'sha256-" + base64.b64encode(hashlib.sha256(content.encode()).digest()).decode() + "'"
        self.assertEqual((len(page.scripts), len(page.styles)), (1, 1))
        policies = [attributes["content"] for name, attributes in page.elements
                    if name == "meta" and attributes.get("http-equiv") == "Content-Security-Policy"]
        self.assertEqual(policies, ["default-src 'none'; base-uri 'none'; form-action 'none'; style-src "
                                    + source(page.styles[0]) + "; script-src " + source(page.scripts[0])])
        with open(SOURCE, encoding="utf-8") as file:
            written = file.read()
        self.assertIn(page.scripts[0], written)
        self.assertNotRegex(written, r"https?:|url\(|@import|innerHTML|outerHTML|insertAdjacentHTML|document\.write|eval\(")

    def test_text_of_peers_is_data(self):
        bytes_ = HOSTILE.encode()
        failed = field(1, 2) + field(2, b"a<b>") + field(3, b"c<d>\xe2\x80\xae\xd8\x9c\x1b\0")
        odd = frame(1, 29, 1, 1, "krutil:" + HOSTILE, b"")
        long = frame(1, 29, 1, 1, "krutil:" + "y" * 60_000, b"")
        self.write(recorded((">", request(1, bytes_)), ("<", text(1, bytes_)), ("<", odd), ("<", long),
                            ("<", reply(1, failed)), process="client <img src=x>"))
        os.rename(self.file, hostile := os.path.join(self.directory, "<b>&\n.pcapng"))
        page = self.page(file=hostile)
        rows = page.rows["messages"][4:]
        self.assertEqual([row[6] for row in rows], [
            f'eval "{SHOWN}"', f'output "{SHOWN}"', "", "",
            'error "a<b>": "c<d>\\u202e\\u061c\\x1b\\x00"'])
        self.assertEqual([row[3] for row in rows],
                         ["IIPEnqueueMessage", "TextBaseEvent", HOSTILE, "y" * 128 + "...", "IIPReply"])
        self.assertEqual([row[7] for row in page.rows["requests"]],
                         ['recorded by "client <img src=x>", ""', f'eval "{SHOWN}"'])
        self.assertEqual(page.rows["requests"][1][6], rows[-1][6])
        self.assertEqual(page.title, f'Recording "{self.directory}/<b>&\\n.pcapng"')
        self.assertEqual(page.title, page.heading)
        self.assertEqual([len(page.scripts), [name for name, _ in page.elements if name in ("img", "b")]], [1, []])

    def test_filters_leave_out_messages_and_keep_latencies(self):
        self.write(recorded((">", request(1, b"a", 1)), (">", request(2, b"b", 2)), ("<", reply(2)), ("<", reply(1))))
        page = self.page("--type", "IIPReply", "--since", "0.000004", "--from", "engine")
        self.assertEqual([row[:5] for row in page.rows["messages"]],
                         [["0.000008", "engine", "00000000", "IIPReply", "0.000002"],
                          ["0.000010", "engine", "00000000", "IIPReply", "0.000006"]])
        self.assertEqual([row[2:5] + row[6:] for row in page.rows["requests"]],
                         [["0.000006", "0.000002", "1", "ok", 'eval "b"'], ["0.000004", "0.000006", "1", "ok", 'eval "a"']])
        self.assertEqual(page.notes, ["6 messages are left out by --type IIPReply --from engine --since 4e-06."])
        page = self.page("--request", "0" * 31 + "2", "--until", "0.0000065")
        self.assertEqual([row[1:5] + row[6:] for row in page.rows["requests"]],
                         [["0", "0.000006", "0.000002", "1", "ok", 'eval "b"']])
        self.assertEqual(page.notes, [f"7 messages are left out by --request {'0' * 31}2 --until 6.5e-06."])
        self.assertEqual(self.page("--type", "none").notes[1:], ["There is no message to show."])

    def test_long_recordings_are_cut_and_the_page_says_so(self):
        self.write(recorded((">", request(1, b"loop()")), *[("<", text(1, b"x"))] * 10_100, ("<", reply(1))))
        page = self.page()
        self.assertEqual(len(page.rows["messages"]), 10_000)
        self.assertEqual(page.notes, ["This page has the first 10000 messages. It leaves out 106 later ones, from 0.010001 to "
                                      "0.010106 seconds: choose others with --since, --until, --request, --type or --from."])
        # The reply has no place on the page, but tells how long the request took.
        self.assertEqual(page.rows["requests"][1][3:5] + page.rows["requests"][1][6:],
                         ["0.010102", "9996", "ok", 'eval "loop()"'])
        self.assertEqual(len(self.page("--since", "0.0100005").rows["messages"]), 106)

    def test_files_that_end_early_or_are_damaged(self):
        whole = recorded((">", request()), ("<", text(1, b"a"))).bytes()
        self.write(whole[:-5])
        sentence = f"the recording ends within a block, at byte {len(whole) - 5}"
        page = self.page(said=f"krutil: {sentence}\n")
        self.assertEqual((len(page.rows["messages"]), page.notes), (5, [f"This page has what is there: {sentence}."]))
        self.write(whole + struct.pack("<IIII", 6, 16, 0, 15))
        said = f"'{self.file}', byte {len(whole) + 12}: length at the end of a block: expected 16, got 15"
        self.assertEqual(self.inspect("--html", self.out, exit_code=2), ("", f"krutil: {said}\n"))
        with open(self.out, encoding="utf-8") as file:
            page = Page(file.read())
        self.assertEqual(page.notes, [f"This page has what the recording says before it is damaged: {said}"])
        self.assertEqual(len(page.rows["messages"]), 6)

    def test_is_a_new_file_for_its_user_alone(self):
        self.write(recorded((">", request())))
        self.inspect("--html", self.out)
        self.assertEqual(stat.S_IMODE(os.stat(self.out).st_mode), 0o600)
        self.assertEqual(sorted(os.listdir(self.directory)), ["session.html", "session.pcapng"])
        with open(self.out, encoding="utf-8") as file:
            self.assertEqual(self.inspect("--html", "-"), (file.read(), ""))
        # Neither an earlier page nor the recording is lost.
        for name in self.out, self.file:
            self.assertEqual(self.inspect("--html", name, exit_code=2),
                             ("", f"krutil: cannot create '{name}': File exists\n"))
        missing = os.path.join(self.directory, "none", "page.html")
        self.assertEqual(self.inspect("--html", missing, exit_code=2),
                         ("", f"krutil: cannot create '{missing}': No such file or directory\n"))
        for other in "--json", "--lint", "--timeline", "--frames", "--fields", "--hex":
            self.assertRegex(self.inspect("--html", self.out, other, exit_code=2)[1],
                             f"^krutil: (--html excludes {other}|{other} excludes --html)\n")


if __name__ == "__main__":
    unittest.main(argv=[sys.argv[0], *sys.argv[3:]])
