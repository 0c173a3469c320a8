"""The page that krutil inspect makes of a recording, in a browser without a screen."""

import json
import os
import subprocess
import tempfile
import unittest

from selenium.webdriver.common.action_chains import ActionChains
from selenium.webdriver.common.by import By
from selenium.webdriver.common.keys import Keys

import browser
from eventually import PATIENCE

KRUTIL = os.path.join(os.environ["KRUTIL_BUILD"], "bin", "krutil")
# Runs if the page takes it for markup.
HOSTILE = "</script><img src=x onerror=hostile=1><script>hostile=1</script>"
LINES = ["import time; print('one'); time.sleep(0.3)", "1 / 0", "import warnings; warnings.warn('careful')",
         f"print({HOSTILE!r})"]


class RecordingPageTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        recording, page = (os.path.join(directory.name, name) for name in ("session.pcapng", "session.html"))
        subprocess.run([KRUTIL, "repl", "--no-history", "--record", recording], input="\n".join(LINES) + "\n", text=True,
                       stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, timeout=PATIENCE, check=False)
        done = subprocess.run([KRUTIL, "inspect", "--json", recording], stdout=subprocess.PIPE, text=True,
                              timeout=PATIENCE, check=True)
        found = [json.loads(line) for line in done.stdout.splitlines()]
        cls.messages = [each for each in found if each["event"] == "message"]
        cls.requests = [each for each in cls.messages if each["type"] == "IIPEnqueueMessage"]
        subprocess.run([KRUTIL, "inspect", recording, "--html", page], timeout=PATIENCE, check=True)
        cls.address = f"file://{page}"
        cls.browser = browser.start(cls, directory.name)

    def setUp(self):
        for log in "browser", "performance":
            self.browser.get_log(log)
        self.browser.get(self.address)

    def tearDown(self):
        """Nothing a test does makes the page complain, ask for anything but itself, or run what a peer has said."""
        self.assertEqual(self.browser.get_log("browser"), [])
        events = [json.loads(entry["message"])["message"] for entry in self.browser.get_log("performance")]
        # The browser's own first page asks for its parts meanwhile.
        asked = [event["params"]["request"]["url"] for event in events
                 if event["method"] == "Network.requestWillBeSent" and event["params"]["documentURL"] == self.address]
        self.assertEqual(asked, [self.address])
        self.assertEqual(self.browser.execute_script("return typeof hostile + document.images.length"), "undefined0")

    def find(self, selector):
        return self.browser.find_elements(By.CSS_SELECTOR, selector)

    def details(self):
        return self.browser.find_element(By.ID, "details").text.split("\n")

    def press(self, *keys):
        """Presses keys one after the other; returns what a screen reader says of the mark that has the focus then."""
        ActionChains(self.browser).send_keys(*keys).perform()
        return self.browser.switch_to.active_element.get_attribute("aria-label")

    def lane_of(self, request):
        """The messages of a request, in the order of their marks."""
        return [each for each in self.messages if each.get("request") == request["request"]]

    def duration(self, request):
        lane = self.lane_of(request)
        return lane[-1]["seconds"] - lane[0]["seconds"]

    def spoken(self, message):
        """The beginning of what a screen reader says."""
        return f"{message['type']} from the {message['sender']}, at {message['seconds']:.6f} s, "

    def go_to_last_mark(self):
        ActionChains(self.browser).key_down(Keys.CONTROL).send_keys(Keys.END).key_up(Keys.CONTROL).perform()
        return self.browser.switch_to.active_element.get_attribute("aria-label")

    def go_to_first_mark(self):
        """With the Tab key, behind the buttons."""
        self.find("#all")[0].send_keys(Keys.TAB)
        # A container that scrolls may be reached first.
        for _ in range(3):
            if self.browser.switch_to.active_element.get_attribute("role") == "gridcell":
                return
            self.press(Keys.TAB)

    def test_lanes_and_marks(self):
        self.assertEqual(len(self.requests), len(LINES))
        rows = self.find("#grid > [role=row]")
        labels = [row.find_element(By.CSS_SELECTOR, "[role=rowheader]").text for row in rows]
        self.assertTrue(labels[0].startswith("session 0 recorded by "), labels)
        self.assertEqual(labels[1:], [f"{each['request'][:8]} {each['summary']}" for each in self.requests])
        self.assertEqual(len(self.find("#grid [role=gridcell]")), len(self.messages))
        for row, request in zip(rows[1:], self.requests):
            marks = row.find_elements(By.CSS_SELECTOR, "[role=gridcell]")
            said = [mark.get_attribute("aria-label") for mark in marks]
            lane = self.lane_of(request)
            self.assertEqual(len(marks), len(lane))
            for text, message in zip(said, lane):
                self.assertTrue(text.startswith(self.spoken(message)), text)
                self.assertIn(f"{message['size']:,} bytes", text)
            self.assertIn("request", marks[0].get_attribute("class").split())
        # From left to right as in time, and bars as long as their requests took.
        first, second = self.lane_of(self.requests[0]), self.lane_of(self.requests[1])
        bars = [bar.size["width"] for bar in self.find("#grid .bar")]
        took = [self.duration(request) for request in self.requests]
        self.assertEqual(bars.index(max(bars)), took.index(max(took)))
        left = [mark.rect["x"] for mark in rows[1].find_elements(By.CSS_SELECTOR, "[role=gridcell]")]
        self.assertEqual(left, sorted(left))
        begin = rows[2].find_element(By.CSS_SELECTOR, "[role=gridcell]").rect["x"]
        scale = (left[-1] - left[0]) / (first[-1]["seconds"] - first[0]["seconds"])
        self.assertAlmostEqual(begin - left[0], (second[0]["seconds"] - first[0]["seconds"]) * scale, delta=2)
        kinds = [[mark.get_attribute("class").split()[1] for mark in row.find_elements(By.CSS_SELECTOR, "[role=gridcell]")]
                 for row in rows[1:]]
        self.assertEqual((kinds[0][-1], kinds[1][-1]), ("reply", "failed"))
        self.assertIn("text", kinds[0])
        self.assertIn("warning", kinds[2])

    def test_pointing_at_a_mark_tells_size_and_latency(self):
        request, *_, reply = self.lane_of(self.requests[0])
        mark = self.find("#grid > [role=row]")[1].find_elements(By.CSS_SELECTOR, "[role=gridcell]")[-1]
        ActionChains(self.browser).move_to_element(mark).perform()
        took = (reply["seconds"] - request["seconds"]) * 1000
        self.assertGreaterEqual(took, 300)
        facts, what, lane = self.details()
        self.assertTrue(facts.startswith(f"IIPReply from the engine at {reply['seconds']:.6f} s, "), facts)
        said = float(facts.partition(" s, ")[2].partition(" ")[0])
        self.assertAlmostEqual(said * (1000 if said < 100 else 1), took, delta=1)
        self.assertIn(" after the request was sent, ", facts)
        self.assertTrue(facts.endswith(f", {reply['size']} bytes"), facts)
        self.assertEqual((what, lane), ("ok", f"{request['request'][:8]}: {request['summary']}"))

    def test_keyboard(self):
        self.go_to_first_mark()
        first = self.messages[0]
        self.assertTrue(self.press(Keys.HOME).startswith(self.spoken(first)))
        session = [each for each in self.messages if "request" not in each]
        self.assertTrue(self.press(Keys.ARROW_RIGHT).startswith(self.spoken(session[1])))
        self.assertTrue(self.press(Keys.ARROW_LEFT, Keys.ARROW_LEFT).startswith(self.spoken(first)))
        lane = self.lane_of(self.requests[0])
        self.assertTrue(self.press(Keys.ARROW_DOWN).startswith(self.spoken(lane[0])))
        self.assertTrue(self.press(Keys.END).startswith(self.spoken(lane[-1])))
        self.assertEqual(self.details()[1], "ok")
        below = self.lane_of(self.requests[1])
        self.assertTrue(self.press(Keys.ARROW_DOWN).startswith(self.spoken(below[0])))
        self.assertTrue(self.press(Keys.ARROW_UP).startswith(self.spoken(lane[-1])))
        last = self.go_to_last_mark()
        self.assertTrue(last.startswith(self.spoken(self.lane_of(self.requests[-1])[-1])), last)
        self.assertEqual(len(self.find("#grid [tabindex='0']")), 1)
        # Zooming keeps the mark in sight, and the whole time comes back.
        width = "return document.querySelector('#axis .track').offsetWidth"
        whole = self.browser.execute_script(width)
        self.press("+")
        self.assertAlmostEqual(self.browser.execute_script(width), 2 * whole, delta=2)
        self.press(Keys.ENTER)
        span = self.messages[-1]["seconds"] - self.messages[0]["seconds"]
        factor = 0.9 * span / self.duration(self.requests[-1])
        self.assertAlmostEqual(self.browser.execute_script(width) / (whole * factor), 1, delta=0.05)
        visible = self.browser.execute_script(
            "const inner = document.activeElement.getBoundingClientRect();"
            "const outer = document.getElementById('scroller').getBoundingClientRect();"
            "return inner.left > outer.left + document.querySelector('.label').offsetWidth && inner.right < outer.right")
        self.assertTrue(visible)
        self.press("0")
        self.assertEqual(self.browser.execute_script(width), whole)

    def test_text_of_peers_is_shown_as_text(self):
        self.go_to_first_mark()
        self.go_to_last_mark()
        self.assertIn(HOSTILE[:20], self.details()[-1])
        self.assertEqual(self.browser.execute_script("return document.scripts.length"), 1)
        cells = self.browser.execute_script(
            "return Array.from(document.querySelectorAll('#messages td:last-child'), cell => cell.textContent)")
        self.assertIn(f'output "{HOSTILE[:60]}"...', cells)

    def test_colours_follow_the_system_and_can_be_told_apart(self):
        def colours(scheme):
            self.browser.execute_cdp_cmd("Emulation.setEmulatedMedia",
                                         {"features": [{"name": "prefers-color-scheme", "value": scheme}]})
            return self.browser.execute_script(
                "const style = getComputedStyle(document.documentElement);"
                "return ['page', 'raised', 'ink', 'quiet', 'session', 'request', 'event', 'text', 'warning', 'failed', 'reply',"
                " 'focus'].map(name => style.getPropertyValue('--' + name).trim())")
        def luminance(colour):
            parts = [int(colour[i:i + 2], 16) / 255 for i in (1, 3, 5)]
            linear = [part / 12.92 if part <= 0.04045 else ((part + 0.055) / 1.055) ** 2.4 for part in parts]
            return 0.2126 * linear[0] + 0.7152 * linear[1] + 0.0722 * linear[2]
        def contrast(one, other):
            light, dark = sorted((luminance(one), luminance(other)), reverse=True)
            return (light + 0.05) / (dark + 0.05)
        schemes = [colours("light"), colours("dark")]
        self.assertLess(luminance(schemes[1][0]), luminance(schemes[0][0]))
        for page, raised, ink, quiet, *marks in schemes:
            for background in page, raised:
                for text in ink, quiet:
                    self.assertGreaterEqual(contrast(background, text), 4.5)
            for mark in marks:
                self.assertGreaterEqual(contrast(page, mark), 3)


if __name__ == "__main__":
    unittest.main()
