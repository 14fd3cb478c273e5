#!/usr/bin/python3
# picture.py OSUTILS TRACE PICTURE: shows the failed removal of a directory in the report of the demo's trace.
import os
import subprocess
import sys
import tempfile

from chromium import Browser, open_report, until

from selenium.webdriver.common.by import By

OSUTILS, TRACE, PICTURE = sys.argv[1:]

with tempfile.TemporaryDirectory(prefix="osutils-browser.") as folder:
    page = os.path.join(folder, "report.html")
    subprocess.run([OSUTILS, "trace", "report", "-o", page, TRACE], check=True, stdout=subprocess.DEVNULL)
    with Browser() as driver:
        driver.execute_cdp_cmd("Emulation.setDeviceMetricsOverride", {
            "width": 1060, "height": 640, "deviceScaleFactor": 1, "mobile": False})
        open_report(driver, page)

        def heading():
            return driver.find_element(By.ID, "panel-heading").text

        def next_failed():
            driver.find_element(By.ID, "next-failed").click()
            return heading() == "deleteDirectory"

        until(next_failed, "a failed call of deleteDirectory")
        next_failed()  # the look at what is in the way
        driver.execute_script("document.activeElement.blur()")
        driver.save_screenshot(PICTURE)
