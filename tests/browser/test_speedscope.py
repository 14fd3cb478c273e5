#!/usr/bin/python3
# test_speedscope.py OSUTILS MAKE_TRACE SPEEDSCOPE: opens what `osutils trace export --format chrome` prints in
# speedscope, whose page is SPEEDSCOPE/index.html, in a headless Chromium.
import base64
import json
import os
import subprocess
import sys
import tempfile
import unittest

from chromium import Browser, find_programs, require_no_network, traced, until

from selenium.webdriver.common.action_chains import ActionChains
from selenium.webdriver.common.by import By

OSUTILS, MAKE_TRACE, SPEEDSCOPE = sys.argv[1:4]


class Speedscope(unittest.TestCase):
    def test_shows_the_functions_of_each_thread(self):
        with tempfile.TemporaryDirectory(prefix="osutils-browser.") as folder:
            trace = os.path.join(folder, "trace")
            traced(MAKE_TRACE, "story", directory=trace)
            chrome = subprocess.run([OSUTILS, "trace", "export", "--format", "chrome", trace], check=True,
                                    capture_output=True).stdout
            threads = {(event["pid"], event["tid"]) for event in json.loads(chrome)["traceEvents"] if event["ph"] == "X"}
            profile = os.path.join(folder, "profile.js")
            with open(profile, "w", encoding="ascii") as file:
                file.write(f'speedscope.loadFileFromBase64("trace.json", "{base64.b64encode(chrome).decode()}")')
            with Browser(arguments=["--enable-unsafe-swiftshader"]) as driver:
                driver.get(f"file://{os.path.abspath(SPEEDSCOPE)}/index.html#localProfilePath={profile}")

                def text():
                    return driver.find_element(By.TAG_NAME, "body").text

                until(lambda: f"/{len(threads)})" in text(), "a profile for each thread", 20)
                ActionChains(driver).send_keys("3").perform()  # the list of functions
                until(lambda: "EtcServices::readEtcServices" in text(), "the list of functions", 20)
                for function in ("checkFilePerms", "doesFileExist", "isMemberOfGroup", "copyFile"):
                    self.assertIn(function, text())


if __name__ == "__main__":
    require_no_network()
    find_programs()
    unittest.main(argv=[sys.argv[0], *sys.argv[4:]], verbosity=2)
