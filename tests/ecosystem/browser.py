"""A browser without a screen, for tests of pages."""

import os
import shutil

from selenium import webdriver
from selenium.webdriver.chrome.service import Service


def start(test, directory):
    """Chromium, until the test class is done. It keeps what it writes in the directory, and logs what pages say to their
    console ("browser") and what they ask of the network ("performance")."""
    options = webdriver.ChromeOptions()
    for option in ("--headless=new", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage",
                   "--window-size=1000,1200", f"--user-data-dir={os.path.join(directory, 'browser')}"):
        options.add_argument(option)
    options.set_capability("goog:loggingPrefs", {"browser": "ALL", "performance": "ALL"})
    browser = webdriver.Chrome(options=options, service=Service(shutil.which("chromedriver")))
    test.addClassCleanup(browser.quit)
    return browser
