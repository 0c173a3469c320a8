"""The notebook kernel in the page of a real Jupyter Notebook, in a browser without a screen."""

import glob
import io
import json
import os
import socket
import subprocess
import unittest

import matplotlib.image
import nbformat
from selenium.webdriver.common.by import By
from selenium.webdriver.support.ui import WebDriverWait

import browser
import jupyter
from eventually import PATIENCE, eventually


class PageTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.directory = jupyter.install(cls)
        cls.notebooks = os.path.join(cls.directory, "notebooks")
        os.mkdir(cls.notebooks)
        # The server does not take port 0. It takes another one when this one is not free any more.
        with socket.socket() as free:
            free.bind(("127.0.0.1", 0))
            port = free.getsockname()[1]
        with open(os.path.join(cls.directory, "server"), "wb") as log:
            cls.server = subprocess.Popen(
                ["jupyter-notebook", "--no-browser", "--allow-root", "--ip=127.0.0.1", f"--port={port}",
                 f"--notebook-dir={cls.notebooks}"], stderr=log)
        cls.addClassCleanup(cls.stop_server)
        cls.address, cls.token = cls.find_server()
        cls.browser = browser.start(cls, cls.directory)

    @classmethod
    def stop_server(cls):
        cls.server.terminate()
        cls.server.wait(PATIENCE)

    @classmethod
    def find_server(cls):
        """The server writes a file when it listens."""
        def look():
            for path in glob.glob(os.path.join(os.environ["JUPYTER_RUNTIME_DIR"], "nbserver-*.json")):
                with open(path, encoding="utf-8") as file:
                    try:
                        said = json.load(file)
                        return said["url"], said["token"]
                    except ValueError:
                        pass  # It is being written.
            if cls.server.poll() is not None:
                with open(os.path.join(cls.directory, "server"), encoding="utf-8") as file:
                    raise AssertionError(file.read())
            return None

        return eventually(look, "the server's file")

    def open(self, *cells):
        """Opens a notebook with these cells, and runs all of them."""
        notebook = nbformat.v4.new_notebook(cells=[nbformat.v4.new_code_cell(cell) for cell in cells])
        notebook.metadata["kernelspec"] = {"name": "krutil", "display_name": "Python (krutil)"}
        nbformat.write(notebook, os.path.join(self.notebooks, "page.ipynb"))
        self.browser.get(f"{self.address}notebooks/page.ipynb?token={self.token}")
        self.wait("return !!(window.Jupyter && Jupyter.notebook && Jupyter.notebook.kernel"
                  " && Jupyter.notebook.kernel.is_connected())")
        self.browser.execute_script("Jupyter.notebook.execute_all_cells()")

    def wait(self, script):
        return WebDriverWait(self.browser, PATIENCE, 0.1).until(lambda browser: browser.execute_script(script))

    def test_cells(self):
        self.open("print('from the engine')\ntwelve = 12", "twelve / 0")
        self.wait("return document.querySelectorAll('.output_error').length === 1")
        self.assertEqual(self.browser.find_element(By.CSS_SELECTOR, ".output_stdout").text, "from the engine")
        error = self.browser.find_element(By.CSS_SELECTOR, ".output_error")
        self.assertTrue(error.text.endswith("\nZeroDivisionError: division by zero"), error.text)
        red = error.find_element(By.CSS_SELECTOR, ".ansi-red-fg")
        self.assertEqual(red.text, "ZeroDivisionError")

    def test_a_plot(self):
        self.open("import matplotlib.pyplot as plt\n"
                  "figure = plt.figure(figsize=(3, 2), dpi=100, facecolor='red')\nfigure.add_axes([0.25, 0.25, 0.5, 0.5],"
                  " facecolor='blue', xticks=[], yticks=[])\nplt.show()")
        self.wait("const picture = document.querySelector('.output_area img');"
                  "return !!picture && picture.complete && picture.naturalWidth === 300")
        picture = self.browser.find_element(By.CSS_SELECTOR, ".output_area img")
        # What a person sees: red around blue, in these proportions.
        seen = matplotlib.image.imread(io.BytesIO(picture.screenshot_as_png))
        height, width = seen.shape[:2]
        self.assertEqual((width, height), (300, 200))
        for place, colour in (((0.1, 0.1), [1, 0, 0]), ((0.5, 0.5), [0, 0, 1]), ((0.9, 0.5), [1, 0, 0]),
                              ((0.3, 0.7), [0, 0, 1])):
            self.assertEqual(seen[int(place[1] * height), int(place[0] * width), :3].tolist(), colour, place)


if __name__ == "__main__":
    unittest.main()
