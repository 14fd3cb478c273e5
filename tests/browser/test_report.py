#!/usr/bin/python3
# test_report.py OSUTILS MAKE_TRACE [UNITTEST_ARGUMENT...]: the page of `osutils trace report` in a headless Chromium, in a
# network namespace without a network.
import json
import os
import subprocess
import sys
import tempfile
import unittest

from chromium import Browser, find_programs, open_report, require_no_network, traced, until

from selenium.webdriver.common.action_chains import ActionChains
from selenium.webdriver.common.actions.wheel_input import ScrollOrigin
from selenium.webdriver.common.by import By
from selenium.webdriver.common.keys import Keys

OSUTILS, MAKE_TRACE = sys.argv[1:3]
GUTTER = 120  # of the page, in pixels
LANE = 18
PROCESS = 22
GAP = 3


class Report(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.folder = tempfile.TemporaryDirectory(prefix="osutils-browser.")
        cls.addClassCleanup(cls.folder.cleanup)
        trace = os.path.join(cls.folder.name, "trace")
        traced(MAKE_TRACE, "story", directory=trace)
        cls.page = cls.report(trace, "report.html")
        lines = subprocess.run([OSUTILS, "trace", "export", "--format", "jsonl", trace], check=True, capture_output=True)
        records = [json.loads(line) for line in lines.stdout.splitlines()]
        cls.calls = [record for record in records if "begin" in record]
        cls.messages = [record for record in records if "text" in record]
        times = [call[key] for call in cls.calls for key in ("begin", "end") if call[key] is not None]
        times += [message["time"] for message in cls.messages]
        cls.range = min(times), max(times)
        cls.browser = Browser()
        cls.addClassCleanup(cls.browser.__exit__)
        cls.driver = cls.browser.__enter__()

    @classmethod
    def report(cls, trace, name):
        path = os.path.join(cls.folder.name, name)
        subprocess.run([OSUTILS, "trace", "report", "-o", path, trace], check=True, stdout=subprocess.DEVNULL)
        return path

    @classmethod
    def made(cls, name, functions, calls, merged=(), messages=()):
        """A page with these records, whose times count from the start: a thread for each number in the first fields."""
        with open(cls.page, encoding="utf-8") as file:
            page = file.read()
        records = ""
        for kind, rows, time_field in (("calls", calls, 3), ("merged", merged, 2), ("messages", messages, 2)):
            chunk = []
            before = 0
            for row in rows:
                chunk += [*row[:time_field], row[time_field] - before, *row[time_field + 1:]]
                before = row[time_field]
            records += f'<script type="application/json" data-records="{kind}">{json.dumps(chunk)}</script>\n'
        threads = 1 + max(row[0] for row in [*calls, *merged, *messages])
        records += '<script type="application/json" id="trace">' + json.dumps({
            "start": "0", "functions": functions, "processes": [["host", "program", 7]],
            "threads": [[0, 70 + i] for i in range(threads)], "notes": [], "summary": []}) + "</script>"
        begin = page.index('<script type="application/json"')
        page = page[:begin] + records + page[page.index("</script>", page.index('id="trace">')) + len("</script>"):]
        path = os.path.join(cls.folder.name, name)
        with open(path, "w", encoding="utf-8") as file:
            file.write(page)
        return path

    def setUp(self):
        self.driver.get_log("browser")
        self.driver.get_log("performance")
        open_report(self.driver, self.page)

    def tearDown(self):
        for entry in self.driver.get_log("browser"):
            if "willReadFrequently" not in entry["message"]:  # which this file causes
                self.fail(entry["message"])

    # ---- What tests do and see ----

    def find(self, name):
        return self.driver.find_element(By.ID, name)

    def text(self, name):
        return self.find(name).get_attribute("textContent")

    def heading(self):
        return self.text("panel-heading")

    def active(self):
        return self.driver.switch_to.active_element

    def axis(self):
        """The ticks: their texts, and their places."""
        return self.driver.execute_script("""
          return [...document.querySelectorAll("#axis .tick")].map((tick) =>
            [tick.textContent, tick.getAttribute("transform")]);""")

    def press(self, *keys):
        """Presses keys one after the other, wherever the focus is."""
        for key in keys:
            ActionChains(self.driver).send_keys(key).perform()

    def search(self, text):
        field = self.find("search")
        field.clear()
        field.send_keys(text, Keys.ENTER)

    def place(self, call):
        """The middle of a call of the only process in the canvas, before any zoom."""
        threads = sorted({other["tid"] for other in self.calls})
        y = PROCESS
        for thread in threads[: threads.index(call["tid"])]:
            y += LANE * (1 + max(other["depth"] for other in self.calls if other["tid"] == thread)) + 2 * GAP
        y += GAP + LANE * call["depth"] + LANE // 2
        width = self.find("canvas").size["width"]
        part = ((call["begin"] + call["end"]) / 2 - self.range[0]) / (self.range[1] - self.range[0])
        return GUTTER + part * (width - GUTTER), y

    def over(self, x, y):
        """Moves the pointer there. Selenium counts from the middle of the element."""
        size = self.find("canvas").size
        return ActionChains(self.driver).move_to_element_with_offset(
            self.find("canvas"), round(x - size["width"] / 2), round(y - size["height"] / 2))

    def failed_call(self, function="checkFilePerms"):
        return next(call for call in self.calls if call["failed"] and call["function"] == function)

    def computed(self, selector, name):
        return self.driver.execute_script(
            "return getComputedStyle(document.querySelector(arguments[0])).getPropertyValue(arguments[1])", selector, name)

    # ---- Loading ----

    def test_loads_and_counts_what_the_trace_has(self):
        failed = sum(call["failed"] is True for call in self.calls)
        self.assertIn(f"1 process, 2 threads, {len(self.calls)} calls, {failed} failed, {len(self.messages)} messages; ",
                      self.text("overview"))
        self.assertEqual(self.text("notes"), "")
        self.assertEqual(self.axis()[0][0], "0 ns")

    def test_requests_nothing_but_itself(self):
        self.press(Keys.TAB)
        requested = []
        for entry in self.driver.get_log("performance"):
            message = json.loads(entry["message"])["message"]
            if message["method"] == "Network.requestWillBeSent":
                requested.append(message["params"]["request"]["url"])
        self.assertEqual(requested, ["file://" + self.page])

    def test_its_policy_forbids_requests_and_scripts_of_others(self):
        forbidden = self.driver.execute_async_script("""
          const done = arguments[0], seen = [];
          document.addEventListener("securitypolicyviolation", (event) => {
            seen.push(event.effectiveDirective);
            if (seen.length === 3) done(seen.sort());
          });
          const script = document.createElement("script");
          script.textContent = "document.title = 'run'";
          document.body.append(script);
          new Image().src = "http://localhost/image";
          fetch("http://localhost/data").catch(() => {});
        """)
        self.assertEqual(forbidden, ["connect-src", "img-src", "script-src-elem"])
        self.assertEqual(self.driver.title, "Trace report")
        self.driver.get_log("browser")  # the violations

    def test_texts_are_never_markup(self):
        self.search("onerror")
        self.assertEqual(self.heading(), "checkFilePerms")
        texts = [pre.text for pre in self.driver.find_elements(By.CSS_SELECTOR, "#panel pre")]
        self.assertEqual(texts, [
            '</script><script>document.title = "run"</script><img src=x onerror=alert(1)>',
            "control \u241b[31m\u2407 and invalid \ufffd\ufffd, \ufffd reversed"])
        self.assertEqual(self.driver.title, "Trace report")
        self.assertEqual(self.driver.find_elements(By.TAG_NAME, "img"), [])
        self.assertEqual(len(self.driver.find_elements(By.TAG_NAME, "script")), 3)  # the trace, D3 and the page's own

    # ---- Search ----

    def test_searches_functions_texts_and_codes(self):
        def of(function):
            return sum(call["function"] == function for call in self.calls)
        with_code_32 = sum(call["code"] == 32 for call in self.calls)
        for text, count in (("COPYfile", of("copyFile")), ("reversed", 1), ("copying", 1), ("32", with_code_32),
                            ("code 32", with_code_32), ("nothing has this", 0)):
            with self.subTest(text):
                self.search(text)
                self.assertEqual(self.text("search-count"), "1 call matches" if count == 1 else f"{count} calls match")

    def test_goes_from_match_to_match(self):
        self.search("copyFile")
        first = self.text("announcement")
        self.assertIn("copyFile, failed, code 0", first)
        self.find("next").click()
        second = self.text("announcement")
        self.assertIn("copyFile, unfinished", second)
        self.find("previous").click()
        self.assertEqual(self.text("announcement"), first)
        self.search("nothing has this")
        self.assertEqual(self.text("announcement"), "No call matches")

    # ---- Mouse ----

    def test_a_click_shows_a_failed_call(self):
        call = self.failed_call()
        self.over(*self.place(call)).click().perform()
        self.assertEqual(self.heading(), "checkFilePerms")
        details = self.text("details")
        self.assertIn("✗ failed, code 32", details)
        self.assertIn("Called by✗ EtcServices::readEtcServices", details)
        self.assertIn("Messages (2)", details)
        self.assertIn("Calls in it (0)", details)
        rest = call["begin"] % 1_000_000_000
        self.assertIn(f".{rest:09}Z", details)

    def test_a_click_on_a_call_lists_the_calls_in_it(self):
        call = next(call for call in self.calls if call["function"] == "checkFilePerms" and not call["failed"])
        self.over(*self.place(call)).click().perform()
        buttons = self.driver.find_elements(By.CSS_SELECTOR, "#panel li button")
        self.assertEqual([button.text for button in buttons], ["doesFileExist", "isDirectory"])
        buttons[1].click()
        self.assertEqual(self.heading(), "isDirectory")
        self.driver.find_element(By.CSS_SELECTOR, "#panel dd button").click()
        self.assertEqual(self.heading(), "checkFilePerms")

    def test_a_yes_is_no_failure_and_an_unfinished_call_is_one(self):
        self.search("isMemberOfGroup")
        self.assertIn("Resultcode 1", self.text("details"))
        self.search("copying")
        self.assertIn("Resultunfinished", self.text("details"))

    def test_the_wheel_zooms_and_the_mouse_drags(self):
        before = self.axis()
        place = self.over(*self.place(self.failed_call()))
        place.perform()
        top = self.driver.execute_script("return scrollY")
        ActionChains(self.driver).scroll_from_origin(ScrollOrigin.from_element(self.find("canvas")), 0, -400).perform()
        zoomed = until(lambda: self.axis() != before and self.axis(), "another axis")
        self.assertEqual(self.driver.execute_script("return scrollY"), top)
        place.click_and_hold().move_by_offset(80, 0).release().perform()
        dragged = until(lambda: self.axis() != zoomed and self.axis(), "another axis")
        self.assertNotEqual(dragged, before)
        self.find("zoom-all").click()
        until(lambda: self.axis() == before, "the first axis")

    def test_failed_calls_are_hatched(self):
        """The colours along a line in the left half of the call, where its name is not: those of a hatching."""
        def colours_in(call):
            x, y = self.place(call)
            width = self.find("canvas").size["width"] - GUTTER
            half = (call["end"] - call["begin"]) / (self.range[1] - self.range[0]) * width / 2
            return self.driver.execute_script("""
              const [from, length, y] = arguments;
              const pixels = document.getElementById("canvas").getContext("2d").getImageData(from, y, length, 1).data;
              const colours = new Set();
              for (let i = 0; i < pixels.length; i += 4) colours.add(pixels.slice(i, i + 3).join());
              return colours.size;""", round(x - half + 2), round(2 * half - 6), y + 6)
        self.assertGreater(colours_in(self.failed_call()), 1)
        self.assertEqual(colours_in(next(call for call in self.calls if call["function"] == "isMemberOfGroup")), 1)

    def test_the_ticks_differ_in_every_view(self):
        self.driver.execute_script("document.getElementById('canvas').focus()")
        for _ in range(10):
            texts = [text for text, _ in self.axis()]
            self.assertEqual(len(texts), len(set(texts)), texts)
            self.press("+++")
        self.assertRegex(texts[-1], r"^\d+\.\d{4,9} ms$")

    # ---- Keys ----

    def test_works_with_keys_alone(self):
        names = []
        while not names or names[-1] != "canvas":
            self.press(Keys.TAB)
            names.append(self.active().get_attribute("id"))
            self.assertLess(len(names), 20)
            self.assertNotEqual(self.driver.execute_script(
                "return getComputedStyle(document.activeElement).outlineStyle"), "none", names[-1])
        self.assertEqual(names, ["search", "previous", "next", "zoom-in", "zoom-out", "zoom-all", "next-failed", "canvas"])
        self.press("f", "f")
        self.assertEqual(self.heading(), "checkFilePerms")
        self.assertIn("failed, code 32", self.text("announcement"))
        self.press(Keys.ARROW_UP)
        self.assertEqual(self.heading(), "EtcServices::readEtcServices")
        self.press(Keys.ARROW_DOWN, Keys.ARROW_DOWN)
        self.assertEqual(self.heading(), "doesFileExist")
        self.press(Keys.ARROW_RIGHT)
        self.assertEqual(self.heading(), "isDirectory")
        self.press(Keys.ARROW_LEFT)
        self.assertEqual(self.heading(), "doesFileExist")
        self.press(Keys.ARROW_LEFT)
        self.assertEqual(self.text("announcement"), "No call before this one")
        self.press("0", "+")
        before = self.axis()
        self.press("+")
        zoomed = until(lambda: self.axis() != before and self.axis(), "another axis")
        self.press("d")
        moved = until(lambda: self.axis() != zoomed and self.axis(), "another axis")
        self.press("0")
        until(lambda: self.axis() != moved and self.axis()[0][0] == "0 ns", "the whole axis")
        self.press(Keys.ENTER)
        self.assertEqual(self.active().get_attribute("id"), "panel-heading")
        self.press(Keys.TAB)
        self.assertEqual(self.active().text, "checkFilePerms")
        self.press(Keys.ENTER)
        self.assertEqual(self.heading(), "checkFilePerms")
        self.press("/", "copyfile", Keys.ENTER, Keys.ESCAPE, "n")
        self.assertEqual(self.heading(), "copyFile")
        self.assertEqual(self.active().get_attribute("id"), "canvas")

    def test_a_heading_sorts_the_summary(self):
        def column(index):
            return [cell.text for cell in self.driver.find_elements(By.CSS_SELECTOR, f"#summary td:nth-child({index + 1})")]
        def sorted_by():
            return [heading.get_attribute("aria-sort")
                    for heading in self.driver.find_elements(By.CSS_SELECTOR, "#summary th")]
        functions = sorted({call["function"] for call in self.calls})
        buttons = self.driver.find_elements(By.CSS_SELECTOR, "#summary th button")
        self.assertEqual(sorted_by().index("descending"), 4)
        self.assertEqual(column(0)[0], "EtcServices::readEtcServices")
        buttons[0].click()
        self.assertEqual(sorted_by()[0], "ascending")
        self.assertEqual(column(0), functions)
        self.driver.execute_script("arguments[0].focus()", buttons[1])
        self.press(Keys.ENTER)
        counts = [int(count) for count in column(1)]
        self.assertEqual(counts, sorted(counts, reverse=True))
        self.assertEqual(sum(counts), len(self.calls))
        self.press(Keys.ENTER)
        self.assertEqual([int(count) for count in column(1)], sorted(counts))
        self.assertEqual(sorted_by()[1], "ascending")
        failures = dict(zip(column(0), column(2)))
        self.assertEqual(failures["checkFilePerms"], "✗ 1 (32: 1)")
        self.assertEqual(failures["isMemberOfGroup"], "0")

    def test_a_function_of_the_summary_is_searched(self):
        for button in self.driver.find_elements(By.CSS_SELECTOR, "#summary td button"):
            if button.text == "isMemberOfGroup":
                button.click()
                break
        self.assertEqual(self.find("search").get_attribute("value"), "isMemberOfGroup")
        self.assertEqual(self.heading(), "isMemberOfGroup")

    # ---- For everybody ----

    def test_everything_that_can_be_used_has_a_name(self):
        self.search("checkFilePerms")
        used = 0
        for node in self.driver.execute_cdp_cmd("Accessibility.getFullAXTree", {})["nodes"]:
            if node["ignored"] or node["role"]["value"] not in (
                    "button", "searchbox", "application", "table", "complementary", "search", "region", "status", "group"):
                continue
            used += 1
            if node["role"]["value"] not in ("search", "status", "table"):
                self.assertTrue(node["name"]["value"], node)
        self.assertGreater(used, 20)

    def test_is_dark_or_light_as_is_preferred(self):
        def luminance(colour):
            parts = [int(part) / 255 for part in colour[colour.index("(") + 1:-1].split(",")[:3]]
            linear = [part / 12.92 if part <= 0.04045 else ((part + 0.055) / 1.055) ** 2.4 for part in parts]
            return 0.2126 * linear[0] + 0.7152 * linear[1] + 0.0722 * linear[2]
        self.search("onerror")
        papers = []
        for scheme in ("light", "dark"):
            self.driver.execute_cdp_cmd("Emulation.setEmulatedMedia", {
                "features": [{"name": "prefers-color-scheme", "value": scheme}]})
            paper = luminance(self.computed("body", "background-color"))
            papers.append(paper)
            for selector in ("body", "#overview", "#panel dt", "#panel .failed", "#summary .failed", "#summary td button"):
                ink = luminance(self.computed(selector, "color"))
                contrast = (max(ink, paper) + 0.05) / (min(ink, paper) + 0.05)
                self.assertGreater(contrast, 4.5, f"{selector}, {scheme}")
            until(lambda: (self.driver.execute_script(
                "return document.getElementById('canvas').getContext('2d').getImageData(2, 300, 1, 1).data[0]") > 128)
                == (scheme == "light"), f"a {scheme} canvas", 10)
        self.driver.execute_cdp_cmd("Emulation.setEmulatedMedia", {"features": []})
        self.assertGreater(papers[0], papers[1])

    # ---- Calls that do not end ----

    def test_an_unfinished_call_ends_with_a_finished_one_around_it(self):
        unfinished = 4
        open_report(self.driver, self.made("unfinished.html", ["outer", "left", "last", "open"], [
            (0, 1, 1, 2000, 2000, unfinished, None), (0, 0, 0, 1000, 3000, 0, 0),
            (0, 1, 3, 6000, 500, unfinished, None), (0, 0, 2, 5000, 1500, unfinished, None), (1, 0, 3, 0, 10000, 0, 0)]))

        def heading_at(time, depth):
            width = self.find("canvas").size["width"]
            self.over(GUTTER + time / 10000 * (width - GUTTER), PROCESS + GAP + LANE * depth + LANE // 2).click().perform()
            return self.heading()
        self.assertEqual([heading_at(3000, 1), heading_at(4800, 1)], ["left", "No call is selected"])
        self.assertEqual([heading_at(9000, 0), heading_at(9000, 1)], ["last", "open"])
        self.search("outer")
        details = self.text("details")
        self.assertIn("Own time1 µs", details)
        self.assertIn("Calls in it (1)left 2 µs, unfinished", details)

    def test_a_call_that_begins_when_another_ends_is_not_in_it(self):
        unfinished = 4
        open_report(self.driver, self.made("touching.html", ["before", "open", "inner", "other"], [
            (0, 0, 0, 0, 1000, 0, 0), (0, 1, 2, 1000, 0, unfinished, None), (0, 0, 1, 1000, 0, unfinished, None),
            (1, 0, 3, 0, 10000, 0, 0)]))
        self.search("inner")
        self.assertIn("Called byopen", self.text("details"))
        width = self.find("canvas").size["width"]
        self.over(GUTTER + 0.5 * (width - GUTTER), PROCESS + GAP + LANE + LANE // 2).click().perform()
        self.assertEqual(self.heading(), "inner")

    # ---- More than a page can hold ----

    def test_reckons_with_merged_calls(self):
        failed = 1
        open_report(self.driver, self.made("merged.html", ["outer", "child", "deep"], [
            (0, 3, 2, 1600, 100, failed, 32), (0, 1, 1, 9500, 200, failed, 32), (0, 0, 0, 0, 10000, 0, 0)],
            [(0, 1, 1000, 8000, 4, 1, 2000, 3)], [(0, 3, 1650, 0, 1, "said in a merged call")]))
        self.assertIn("1 thread, 10 calls, 3 failed, 1 message; ", self.text("overview"))
        self.search("outer")
        self.assertEqual(self.text("search-count"), "1 call matches; merged calls are found only by their messages")
        details = self.text("details")
        self.assertIn("Own time7.8 µs", details)
        self.assertIn("Calls in it (5)4 calls", details)
        self.search("said")
        self.assertEqual(self.heading(), "4 calls")
        details = self.text("details")
        self.assertIn("Merged too3 calls in them", details)
        self.assertIn("Called byouter", details)
        self.search("deep")
        self.assertIn("Called by4 calls", self.text("details"))

    def test_merges_calls_when_there_are_too_many(self):
        trace = os.path.join(self.folder.name, "many")
        count = 1_100_000
        traced(MAKE_TRACE, str(count), "2", directory=trace)
        open_report(self.driver, self.report(trace, "many.html"))
        overview = self.text("overview")
        self.assertIn("2 threads, 1,100,000 calls, ", overview)
        summary = json.loads(subprocess.run([OSUTILS, "--json", "trace", "summary", trace], check=True, capture_output=True).stdout)
        failed = sum(sum(function["failures"].values()) for function in summary["functions"])
        self.assertIn(f" {failed:,} failed, ", overview)
        notes = [note.text for note in self.driver.find_elements(By.CSS_SELECTOR, "#notes li")]
        self.assertRegex(notes[0], r"^\d+ of 1100000 calls are merged with their neighbours, .* that have not failed\.")
        self.search("checkFilePerms")
        self.assertRegex(self.text("search-count"), "calls match; merged calls are found only by their messages$")
        self.press(Keys.ESCAPE, "f")
        self.assertIn("failed, code 32", self.text("announcement"))
        self.search("readEtcServices")
        for _ in range(30):
            self.assertIn("Calls in it (4)", self.text("details"))
            self.find("next").click()


if __name__ == "__main__":
    require_no_network()
    find_programs()
    unittest.main(argv=[sys.argv[0], *sys.argv[3:]], verbosity=2)
