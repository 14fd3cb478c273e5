#!/usr/bin/python3
# measure.py OSUTILS MAKE_TRACE REPORT: opens a page of 200,000 records in a headless Chromium and zooms it, several
# times. Writes the times to REPORT, in the form of the reports of Google Benchmark.
import json
import os
import re
import subprocess
import sys
import tempfile
import time

from chromium import Browser, open_report, skip, traced

from selenium.webdriver.common.by import By

OSUTILS, MAKE_TRACE, REPORT = sys.argv[1:]
RECORDS = 200_000
PLACES = (.1, .3, .5, .7, .9)  # of the calls' width; each is zoomed in a page that was opened anew
GUTTER = 120                   # of the page, in pixels
STEPS = 40                     # of the wheel, in one direction

MEASURE_FRAMES = """
  window.frames = [];
  let last = performance.now();
  requestAnimationFrame(function frame() {
    const now = performance.now();
    window.frames.push(now - last);
    last = now;
    requestAnimationFrame(frame);
  });
"""
LONGEST_FRAME = """
  const done = arguments[0];
  requestAnimationFrame(() => requestAnimationFrame(() => done(Math.max(...window.frames))));
"""


def make_page(folder):
    trace, page = os.path.join(folder, "trace"), os.path.join(folder, "report.html")
    calls = RECORDS * 10 // 21 + 100  # a call has two records, and every tenth a message
    traced(MAKE_TRACE, str(calls), "8", directory=trace)
    made = subprocess.run([OSUTILS, "trace", "report", "-o", page, trace], stdout=subprocess.DEVNULL,
                          stderr=subprocess.PIPE, text=True)
    if "the package node-d3" in made.stderr:
        skip("node-d3 is not installed")
    if made.returncode != 0:
        sys.exit(made.stderr)
    return page


def require_all_records(driver):
    overview = driver.find_element(By.ID, "overview").text
    calls, messages = (int(re.search(f"([0-9,]+) {what}", overview)[1].replace(",", "")) for what in ("calls", "messages"))
    if 2 * calls + messages < RECORDS or driver.find_elements(By.CSS_SELECTOR, "#notes li"):
        sys.exit(f"the page does not have all of {RECORDS} records: {overview}")


def axis(driver):
    return [tick.text for tick in driver.find_elements(By.CSS_SELECTOR, "#axis .tick")]


def turn_wheel(driver, place, delta):
    canvas = driver.find_element(By.ID, "canvas").rect
    for _ in range(STEPS):
        driver.execute_cdp_cmd("Input.dispatchMouseEvent", {
            "type": "mouseWheel", "x": canvas["x"] + GUTTER + place * (canvas["width"] - GUTTER),
            "y": canvas["y"] + canvas["height"] / 3, "deltaX": 0, "deltaY": delta})


def longest_frame(driver, place):
    """In milliseconds, while the wheel zooms as far as it can, and back."""
    axes = [axis(driver)]
    driver.execute_script(MEASURE_FRAMES)
    for delta in (-240, 240):
        turn_wheel(driver, place, delta)
        axes.append(axis(driver))
    longest = driver.execute_async_script(LONGEST_FRAME)
    if axes[1] in (axes[0], axes[2]):
        sys.exit(f"the wheel did not zoom: {axes}")
    return longest


if not os.access(MAKE_TRACE, os.X_OK):
    skip("osutils-trace was not built")
with tempfile.TemporaryDirectory(prefix="osutils-browser.") as folder, Browser() as driver:
    page = make_page(folder)
    runs = []
    for place in PLACES:
        driver.get("about:blank")
        start = time.monotonic()
        open_report(driver, page)
        runs.append({"run_name": "page/open", "seconds": time.monotonic() - start})
        require_all_records(driver)
        runs.append({"run_name": "page/zoom", "ms_of_longest_frame": longest_frame(driver, place)})
for run in runs:
    print(*run.values())
    run["run_type"] = "iteration"
with open(REPORT, "w", encoding="ascii") as file:
    json.dump({"benchmarks": runs}, file)
