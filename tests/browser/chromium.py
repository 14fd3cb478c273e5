# What the programs of this folder share: a headless Chromium that is moved by its driver.
import os
import shutil
import subprocess
import sys
import tempfile
import time

SKIP = 77  # an exit status


def skip(reason):
    print("Skipped: " + reason)
    sys.exit(SKIP)


try:
    from selenium import webdriver
    from selenium.webdriver.chrome.options import Options
    from selenium.webdriver.chrome.service import Service
except ImportError:
    skip("python3-selenium is not installed")


def find_programs():
    found = [shutil.which(name) for name in ("chromium", "chromedriver")]
    if None in found:
        skip("chromium and chromium-driver are not installed")
    return found


def require_no_network():
    """Skips unless the loopback interface is the only one: then no request can leave, and none succeeds."""
    interfaces = [line.split(":")[0].strip() for line in open("/proc/net/dev") if ":" in line]
    if interfaces != ["lo"]:
        skip("needs a network namespace without a network")


class Browser:
    """A driver in a profile of its own, both of which end with the scope."""

    def __init__(self, width=1280, height=1000, arguments=()):
        chromium, driver = find_programs()
        self.profile = tempfile.mkdtemp(prefix="osutils-browser.")
        options = Options()
        options.binary_location = chromium
        for argument in (
            "--headless=new", "--disable-gpu", "--disable-dev-shm-usage", "--disable-background-networking",
            "--force-device-scale-factor=1", "--user-data-dir=" + self.profile, f"--window-size={width},{height}",
            *arguments,
        ):
            options.add_argument(argument)
        if os.geteuid() == 0:
            options.add_argument("--no-sandbox")
        options.set_capability("goog:loggingPrefs", {"browser": "ALL", "performance": "ALL"})
        self.driver = webdriver.Chrome(service=Service(driver), options=options)
        self.driver.execute_cdp_cmd("Network.enable", {})

    def __enter__(self):
        return self.driver

    def __exit__(self, *_):
        try:
            self.driver.quit()
        finally:
            shutil.rmtree(self.profile, ignore_errors=True)


def until(condition, what, seconds=60):
    """Waits until `condition` returns something true, and returns it."""
    end = time.monotonic() + seconds
    while True:
        found = condition()
        if found:
            return found
        if time.monotonic() > end:
            raise AssertionError("waited in vain: " + what)
        time.sleep(0.02)


def open_report(driver, path):
    driver.get("file://" + os.path.abspath(path))
    until(lambda: driver.execute_script("return document.documentElement.hasAttribute('data-ready')"), "the page is ready")


def traced(program, *arguments, directory):
    """Runs a program that leaves a trace in the directory."""
    environment = dict(os.environ, TRC_DIR=directory, TRC_EVENTS="all")
    subprocess.run([program, *arguments], env=environment, check=True)
