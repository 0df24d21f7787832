#!/usr/bin/env python3
"""The report page, looked at in a real browser."""
import json
import os

import harness
from browser import Browser, Page
from harness import Entry, MachineTest, log_event, point
from mixed_day import mixed_day

PAIRS = 4096  # as many as a run admits
VERDICTS = ("reported", "telemetry_disabled", "string_whitelist", "duration", "downsampled", "class_not_supported")
MARKUP = ["<script>window.ran = 1</script>", "\"><img src=http://127.0.0.1:9/x onerror=ran=1>", "</style><b>", "&lt;b&gt;",
          "'--><svg/onload=ran=1>", "</script><script>ran=1</script>", "</title><iframe src=http://127.0.0.1:9/>"]
UNSEEN = ["\x1b", "\x00", "\x85", "\u202e", "\u2066", "\u200b", "\u200d", "\ufeff", "\u00a0", "\u00ad", "\U000e0041", "\ufe0f"]

# The cells of each row: the number of a cell that has one, else its text.
ROWS = """[...document.querySelectorAll('#%s tbody tr')].filter(row => !row.hidden).map(row => [...row.cells].map(cell => {
  const data = cell.querySelector(':scope > data'); return data ? Number(data.value) : cell.textContent; }))"""
SEEN = "(element => element.checkVisibility({contentVisibilityAuto: true, visibilityProperty: true}))"


class PageTest(MachineTest):
    @classmethod
    def setUpClass(cls):
        cls.browser = Browser()
        cls.addClassCleanup(cls.browser.close)

    def make(self, *arguments):
        path = os.path.join(self.machine.root, "page.html")
        self.assert_clean(self.machine.ctl("report", "--html", path, *arguments))
        return path

    def open(self, path, **how):
        page = Page(self.browser, path, **how)
        self.addCleanup(page.close)
        return page

    def rows(self, page, table):
        return page.run(ROWS % table)

    def assert_quiet(self, page):
        """Nothing was logged, nothing went wrong, and nothing but the page itself was asked for."""
        self.assertEqual(page.events("Log.entryAdded", "Runtime.consoleAPICalled", "Runtime.exceptionThrown"), [])
        self.assertEqual([event["request"]["url"] for event in page.events("Network.requestWillBeSent")],
                         [page.run("location.href")])

    def summary(self):
        return json.loads(self.assert_clean(self.machine.ctl("explain", "--summary", "--json")).out)


class Figures(PageTest):
    def test_they_are_those_of_explain(self):
        self.machine.write_export(mixed_day(self.machine)[0])
        self.assert_clean(self.machine.run())
        summary = self.summary()
        for arguments in ((), ("--last-run",)):
            page = self.open(self.make(*arguments))
            self.assertEqual([row[1] for row in self.rows(page, "verdicts")], [summary["verdicts"][name] for name in VERDICTS])
            self.assertEqual({row[0]: row[1:3] for row in self.rows(page, "pairs")},
                             {f"{pair['subsystem']} / {pair['category']}": [sum(pair[name] for name in VERDICTS), pair["reported"]]
                              for pair in summary["pairs"]})
            # Parts of a bar stand apart, and the last one ends where the bar does.
            bars = page.run("""[...document.querySelectorAll('svg.page, svg.row:not(.spread)')].map(bar =>
                [...bar.querySelectorAll('rect')].map(part => ['x', 'width'].map(name => Number(part.getAttribute(name)))))""")
            self.assertGreater(max(map(len, bars)), 3)
            for bar in bars:
                self.assertAlmostEqual(sum(bar[-1]), 1000, delta=0.3)
                self.assertTrue(all(part[0] - sum(before) > 2 for before, part in zip(bar, bar[1:])), bar)
            self.assertEqual(sum(sum(row[1:]) for row in self.rows(page, "slices")), summary["trace_objects"])
            self.assertEqual({row[0] or "(empty)": row[1] for row in self.rows(page, "misses")},
                             {miss["value"] or "(empty)": miss["count"] for miss in summary["whitelist_misses"]})
            self.assertEqual({row[0]: {"reported": row[1], "unreported": row[2]} for row in self.rows(page, "kinds")},
                             summary["kinds"])
            for table, shown in (("durations", ("count", "p50", "p95", "p99", "max")), ("frame_rates", ("count", "min", "p1", "p5", "p50"))):
                self.assertEqual({row[0]: [float(value) for value in row[1:6]] for row in self.rows(page, table)},
                                 {f"{row['subsystem']} / {row['category']} / {row['name'] or '(empty)'}": [float(row[name]) for name in shown]
                                  for row in summary[table] if row["count"]})

    def test_equal_values_are_one_row(self):
        self.machine.write_export([point("event", "com.vantor.A", f"C{at}", "N", string1=("size", value))
                                   for at, value in enumerate(("vast", "odd", "vast", "vast"))])
        page = self.open(self.make())
        rows = self.rows(page, "misses")
        self.assertEqual([row[:2] for row in rows], [["vast", 3], ["odd", 1]])
        self.assertTrue(rows[0][2].startswith("3 trace points"))
        self.assertEqual(page.run("[...document.querySelectorAll('#misses li')].map(item => item.textContent)"),
                         [f"1 \u00d7 com.vantor.A / C{at} / N string 1" for at in (0, 2, 3)])
        self.assertEqual(self.rows(self.open(self.make("--without-values")), "misses"),
                         [[f"com.vantor.A / C{at} / N string 1", 1, 1] for at in range(4)])

    def test_few_and_none(self):
        self.machine.write_export([log_event("nothing else")])
        self.assertEqual([row[1] for row in self.rows(self.open(self.make()), "verdicts")], [0] * len(VERDICTS))
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", "Open")])
        page = self.open(self.make())
        [busiest] = self.rows(page, "slices")
        self.assertIn(f"most, 1, from {busiest[0]}.", page.run("document.querySelector('.chart svg').getAttribute('aria-label')"))

    def test_losses_and_problems(self):
        self.machine.write_export([log_event("early", at=-90000), point("event", "a", "b"), point("evnt", "a", "b"), Entry(
            [("TESSEL_LOST", "5"), ("TESSEL_LOST_SINCE", str(int((self.machine.now - 60) * 1e6)))], uid=1000)])
        self.assert_clean(self.machine.run())
        with open(os.path.join(self.machine.store, "<b>.export"), "wb") as file:
            file.write(b"no equals sign\n\n")
        page = self.open(self.make("--last-run"))
        malformed = ["malformed unknown TESSEL_KIND", 1]
        self.assertEqual([row[:2] for row in self.rows(page, "run_losses")], [malformed])
        self.assertEqual([row[:2] for row in self.rows(page, "losses")], [["file_damaged line that is no field", 1], malformed])
        self.assertEqual([row[1:] for row in self.rows(page, "lost_at_source")], [[5, "user 1000, /opt/Clock.AppDir/usr/bin/Clock"]])
        self.assertEqual(self.rows(page, "losses")[0][2], os.path.join(self.machine.store, "<b>.export, byte 0"))
        status = json.loads(self.machine.ctl("status", "--json").out)
        for kind in ("problems", "notes"):
            self.assertEqual(page.run(f"[...document.querySelectorAll('#findings .{kind} li')].map(item => item.firstChild.textContent)"),
                             [finding["code"] for finding in status[kind]])
        self.assertIsNone(self.open(self.make("--store", self.machine.store)).run("document.querySelector('#findings')"))
        tasking = "document.querySelector('#tasking')"
        self.assertIsNone(page.run(tasking))
        self.machine.task('{"TaskedOn": false}')
        self.assertRegex(self.open(self.make()).run(tasking + ".textContent"), f"^Reporting is off. {self.machine.config}/.* says so. ")
        self.assertRegex(self.open(self.make("--without-values")).run(tasking + ".textContent"), '^Reporting is off. "Reported" tells')


class Hostile(PageTest):
    def setUp(self):
        super().setUp()
        self.texts = MARKUP + ["caf\udce9", "line\nfeed", "\u05d0\u05d1", "a\u0301" * 300, "x" * 1000 + "end"]
        self.texts += [f"a{unseen}b" for unseen in UNSEEN]
        self.machine.write_export([point("event", "com.vantor." + text, text, text, string1=(text, text), duration="0.25", at=-60 - i)
                                   for i, text in enumerate(self.texts)])

    def test_names_stay_names_and_fit_everywhere(self):
        path = self.make()
        for width in (400, 800, 1400):
            for dark in (False, True):
                page = self.open(path, width=width, dark=dark)
                page.run("document.querySelectorAll('details').forEach(part => part.open = true)")
                self.assert_quiet(page)
                self.assertEqual(page.run("document.documentElement.scrollWidth"), width)
                self.assertEqual(page.run("""[...document.querySelectorAll('section > table, section > details > table')].filter(table => {
                    const card = table.closest('section'), end = card.getBoundingClientRect().right - parseFloat(getComputedStyle(card).paddingRight);
                    return table.getBoundingClientRect().right > end; }).map(table => table.id)"""), [])
                self.assertIsNone(page.run("window.ran ?? null"))
        self.assertEqual(page.run("document.querySelectorAll('script, img, iframe, b, bdi > :not(wbr)').length"), 1 + 4)
        names = page.run("[...document.querySelectorAll('#pairs bdi')].map(name => name.title || name.textContent)")
        self.assertEqual(len(names), 2 * len(self.texts))
        for text in MARKUP + ["\u05d0\u05d1", "a\u0301" * 300, "x" * 1000 + "end", "caf\ufffd", "line\u240afeed", "a\u241bb", "a\u2400b"]:
            self.assertIn(text, names)
        for unseen in UNSEEN[2:]:
            self.assertIn(f"a[U+{ord(unseen):04X}]b", names)
        self.assertLessEqual(page.run("Math.max(...[...document.querySelectorAll('bdi')].map(name => [...name.textContent].length))"), 64)
        with open(path, encoding="utf-8", newline="") as file:
            text = file.read()
        self.assertFalse([unseen for unseen in UNSEEN + ["\udce9"] if unseen in text])

    def test_the_policy_holds_where_escaping_failed(self):
        path = self.make()
        with open(path, encoding="utf-8") as file:
            text = file.read()
        with open(path, "w", encoding="utf-8") as file:
            file.write(text.replace("<main>", "<main><link rel=stylesheet href=http://127.0.0.1:9/><style>main{display:none}</style>"
                                    "<base href=http://127.0.0.1:9/>" + "".join(MARKUP), 1))
        page = self.open(path)
        self.assertIsNone(page.run("window.ran ?? null"))
        self.assertEqual(page.run("getComputedStyle(document.querySelector('main')).display"), "block")
        refused = " ".join(event["entry"]["text"] for event in page.events("Log.entryAdded"))
        for directive in ("script-src", "style-src", "default-src", "base-uri"):
            self.assertIn(directive, refused)


class Use(PageTest):
    """At as many pairs as a run admits."""

    def setUp(self):
        super().setUp()
        self.machine.write_export([
            point("event", f"com.vantor.App{at % 97}", f"Category{at}", "Open", string1=("size", "small" if at % 3 else f"odd{at % 60}"),
                  duration=f"{at % 50}.5", uid=at % 16, at=-80000 + at * 15) for at in range(PAIRS) for _ in range(1 + (at == 77) + at % 2)] +
            [point("event", "com.vantor.Greedy", f"More{at}", uid=7) for at in range(50)])
        self.path = self.make()

    def test_the_whole_list_is_there_and_small(self):
        self.assertLess(os.path.getsize(self.path), 5 << 20)
        page = self.open(self.path)
        page.run("document.querySelectorAll('main > section > details').forEach(part => part.open = true)")
        took = page.run("""(() => { const begin = performance.now(); document.querySelector('#pairs button').click();
            document.body.offsetHeight; return performance.now() - begin + performance.getEntriesByType('navigation')[0].duration; })()""")
        self.assertLess(took, 10_000)
        self.assertEqual((len(self.rows(page, "pairs_first")), len(self.rows(page, "pairs"))), (20, PAIRS))
        self.assertEqual(sum(row[1] for row in self.rows(page, "pairs")), self.summary()["trace_objects"])
        self.assertEqual([row[1:] for row in self.rows(page, "over_share")], [[50, "user 7, /opt/Clock.AppDir/usr/bin/Clock"]])
        self.assertEqual(page.run("""[...document.querySelectorAll('table')].filter(table => !table.caption?.textContent ||
            table.querySelector('th:not([scope])') || !table.querySelector('tbody th[scope=row]')).map(table => table.id)"""), [])

    def test_sorting_and_filtering_by_keyboard(self):
        page = self.open(self.path, width=800)
        controls = page.run("""[...document.querySelectorAll('summary, button, input, .scroll')].filter(""" + SEEN + ").length")
        reached = []
        while True:
            page.press("Tab")
            name = page.run("""(element => element === document.body ? null : element.textContent + element.id + ' ' + element.tagName + ' ' +
                               getComputedStyle(element).outlineWidth)(document.activeElement)""")
            if name is None:
                break
            self.assertTrue(name.endswith(" 2px"), name)
            reached.append(name)
            self.assertLess(len(reached), 200)
        self.assertGreater(controls, 3)
        self.assertEqual(len(reached), controls)

        def go_to(what):
            while not page.run(f"document.activeElement.matches({what!r})"):
                page.press("Tab")

        page.press("Tab")
        go_to("details:has(#pairs) > summary")
        self.assertFalse(page.run(SEEN + "(document.querySelector('#pairs'))"))
        page.press("Enter")
        self.assertTrue(page.run(SEEN + "(document.querySelector('#pairs'))"))
        go_to(".filter input")
        page.type("APP7 category7")
        wanted = {f"com.vantor.App{at % 97} / Category{at}": 1 + (at == 77) + at % 2 for at in range(PAIRS)}
        wanted = {pair: count for pair, count in wanted.items() if "App7" in pair and "Category7" in pair}
        self.assertEqual({pair: count for pair, count, _, _ in self.rows(page, "pairs")}, wanted)
        self.assertEqual(page.run("document.querySelector('.filter output').value"), f"{len(wanted)} of 4,096")
        go_to("#pairs th:nth-child(2) button")
        page.press(" ")
        counts = page.run("[...document.querySelectorAll('#pairs tbody tr')].map(row => Number(row.cells[1].firstChild.value))")
        self.assertEqual(counts, sorted(counts, reverse=True))
        page.press(" ")
        self.assertEqual(page.run("[...document.querySelectorAll('#pairs thead th')].map(head => head.ariaSort)"),
                         [None, "ascending", None, None])
        self.assert_quiet(page)

    def test_whole_without_script(self):
        whole = self.open(self.path)
        with open(self.path, encoding="utf-8") as file:
            text = file.read()
        with open(self.path, "w", encoding="utf-8") as file:
            file.write(text.replace("script-src 'sha256", "script-src 'none' 'x"))
        for page in (self.open(self.path, script=False), self.open(self.path)):
            self.assertEqual(page.run("document.querySelectorAll('main button, main input').length"), 0)
            for table in ("verdicts", "pairs_first", "pairs", "misses", "durations", "slices"):
                self.assertEqual(self.rows(page, table), self.rows(whole, table))
                self.assertGreater(len(self.rows(page, table)), 0)


class Look(PageTest):
    def test_contrast(self):
        def luminance(colour):
            parts = [int(colour[at:at + 2], 16) / 255 for at in (1, 3, 5)]
            parts = [part / 12.92 if part <= 0.04045 else ((part + 0.055) / 1.055) ** 2.4 for part in parts]
            return 0.2126 * parts[0] + 0.7152 * parts[1] + 0.0722 * parts[2]

        self.machine.write_export([log_event("nothing else")])
        path = self.make()
        for dark, media in ((False, "screen"), (True, "screen"), (False, "print")):
            page = self.open(path, dark=dark)
            page.call("Emulation.setEmulatedMedia", media=media,
                      features=[{"name": "prefers-color-scheme", "value": "dark" if dark else "light"}])
            names = ("page", "card", "code", "ink", "soft", "good", "bad", "focus", "edge") + VERDICTS
            colours = page.run(f"""Object.fromEntries({json.dumps(names)}.map(name =>
                [name, getComputedStyle(document.documentElement).getPropertyValue('--' + name)]))""")
            text = [(name, ground, 4.5) for name in ("ink", "soft", "good", "bad", "focus") for ground in ("card", "page")]
            text += [("ink", "code", 4.5), ("soft", "code", 4.5)]
            parts = [(name, "card", 3) for name in VERDICTS + ("edge",)] + [(*pair, 3) for pair in zip(VERDICTS, VERDICTS[1:])]
            for one, other, least in text + parts:
                low, high = sorted(luminance(colours[name]) for name in (one, other))
                self.assertGreaterEqual((high + 0.05) / (low + 0.05), least, (one, other, dark, media))


if __name__ == "__main__":
    harness.main()
