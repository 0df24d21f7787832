#!/usr/bin/env python3
"""A local user tries to harm the service: floods, odd bytes, values at every limit.

TESSEL_HOSTILE_POINTS is the number of trace points in a flood.
"""
import itertools
import json
import os
import re

import harness
from harness import Entry, MachineTest, point
from measure import run_measured

POINTS = int(os.environ.get("TESSEL_HOSTILE_POINTS", "5000" if harness.SANITIZED else "50000"))
MAX_PAIRS = 4096
MAX_OF_A_PROGRAM = MAX_PAIRS * 9 // 16  # what all others leave it
MAX_OPEN_INTERVALS = 65536
HOSTILE, HONEST = 1000, 1001  # users
MEMORY = 64 << 10  # KiB that are not pages of files
ODD = ["\x1b[31mred\x1b[0m\x1b]0;title\x07", "\r\nerror: forged line\n", "%s%n%@%llu%1000000d", "<b>&lt;\"'`$(reboot)",
       "\u202egnp.exe", "\x00nul", "\x7f\x9b31m\x85", "a" * 4096, "..", "/", "{\"TaskedOn\":true}", "'; DROP TABLE events; --",
       b"\xff\xfe\xc0\xaf\xed\xa0\x80".decode("utf-8", "surrogateescape"), "\ufeff\ufffe\U0010ffff", ""]
# A terminal acts on control characters. Tab and line feed are harmless.
TERMINAL = re.compile("[\x00-\x08\x0b-\x1f\x7f-\x9f]")


def assert_plain(test, text):
    found = TERMINAL.search(text)
    test.assertIsNone(found, found and repr(text[max(0, found.start() - 40):found.end() + 40]))
    test.assertEqual(text, text.encode("utf-8", "replace").decode("utf-8"), "well-formed throughout")


def honest(kind, first, category="View{}", **fields):
    """50 trace points that are reported where their writer gets what is his."""
    return [point(kind, "com.vantor.Honest", category.format(i), "N", interval=str(i), at=first + i * 0.001, uid=HONEST, **fields)
            for i in range(50)]


class Flood(MachineTest):
    def run_flood(self, entries, **extra):
        self.machine.write_export(entries)
        cost = run_measured(self.machine, **extra)
        self.assertEqual(cost.status, 0, cost.stderr[-2000:])
        count = self.statistics()["LogObjectsProcessed"]
        print(f"{self.id().split('.')[-1]}: {count} entries, {cost.anonymous} KiB, {cost.seconds:.1f} s, "
              f"{cost.processor_seconds:.1f} s of a processor")
        if not harness.SANITIZED:
            self.assertLessEqual(cost.anonymous, MEMORY)
        return cost.log

    def statistics(self):
        return dict(self.machine.rows()[-1][1])

    def test_each_point_with_a_category_of_its_own(self):
        entries = (point("event", "com.vantor.Flood", f"Category {i}", "N", telemetry=False, at=-3600 + i * 0.001,
                         uid=100000 + i % 1100, owner=HOSTILE, exe="/opt/flood") for i in range(POINTS))
        gone = (point("event", "com.vantor.Flood", f"Gone {i}", "N", telemetry=False, at=-60 + i * 0.001,
                      uid=100000 + i % 40, exe=None) for i in range(2000))  # processes that ended at once
        log = self.run_flood(itertools.chain(entries, gone, honest("event", -10)))
        delivered, unknown = MAX_OF_A_PROGRAM, MAX_PAIRS // 16
        statistics = self.statistics()
        self.assertEqual(statistics["LogObjectsProcessed"], POINTS + 2000 + 50)
        self.assertEqual(statistics["EventsNotReported"], delivered + unknown)
        self.assertEqual(statistics["EventsReported"], 50, "each with a pair of its own")
        summary = json.loads(self.assert_clean(self.machine.ctl("explain", "--summary", "--json")).out)
        self.assertEqual(summary["over_share"], [
            {"uid": HOSTILE, "image": "/opt/flood", "what": "pairs", "count": POINTS - delivered},
            {"image": "unknown", "what": "pairs", "count": 2000 - unknown}])
        said = [line for line in log if "Trace store: lost" in line and "too many pairs of subsystem and category" in line]
        self.assertEqual(len(said), 2)
        self.assertIn(f"lost {POINTS - delivered} beyond_pair_limit", said[0])
        # The log lists all pairs; the summary sends the pairs with most objects, and each send waits for its turn.
        self.assertEqual(sum("com.vantor.Flood/Category" in line for line in log), delivered)
        self.assertEqual(len(self.machine.rows()), 2 * 50 + 3 * 5 + 1)

    def test_a_category_of_its_own_and_a_long_one(self):
        long = "x" * 4000
        entries = (point("event", "com.vantor.Flood", f"{long}{i}", "N", telemetry=False, at=-3600 + i * 0.001)
                   for i in range(max(POINTS // 5, 2000)))
        log = self.run_flood(entries)
        self.assertLess(self.statistics()["EventsNotReported"], MAX_PAIRS, "text is bounded as well")
        self.assertTrue(any("too many pairs of subsystem and category" in line for line in log))

    def test_intervals_that_never_end(self):
        count = max(2 * POINTS, MAX_OPEN_INTERVALS + 1000)
        entries = (point("begin", "com.vantor.Flood", "Open", f"N{i % 7}", interval=str(i), telemetry=False, uid=HOSTILE,
                         at=-3600 + i * 0.001, attributes=[("key", "v" * 60 + str(i))]) for i in range(count))
        last = point("end", "com.vantor.Flood", "Open", f"N{(count - 1) % 7}", interval=str(count - 1),
                     telemetry=False, at=-10)
        large = (point("begin", "com.vantor.Flood", "Large", interval=str(i), at=-60 + i * 0.1, uid=HOSTILE + 2,
                       attributes=[(str(k), f"{i}-{k}-".ljust(4000, "v")) for k in range(32)]) for i in range(100))
        log = self.run_flood(itertools.chain(honest("begin", -4000), entries, large, [last], honest("end", -5)))
        self.assertEqual(self.statistics()["IntervalsNotReported"], 1, "the youngest is still open")
        self.assertEqual(self.statistics()["IntervalsReported"], 50, "whoever floods us loses his own")
        self.assertTrue(any("open_interval_dropped: begins that were too many to wait" in line for line in log), log[-5:])

    def test_time_and_programs_run_out(self):
        """Side by side, because both runs sleep most of the time: junk of one program, then of 29,000."""
        other = harness.Machine()
        self.addCleanup(other.close)
        other.task()
        other.write_export([point("event", "com.vantor.Flood", "View", "N", at=-3600 + i * 0.001, uid=HOSTILE)
                            for i in range(2000)] + honest("event", -10, "View"))
        running = other.start(TESSEL_RUN_LIMIT="24")
        programs = (point("event", "com.vantor.Flood", "View", "N", at=-3600 + i * 0.001, uid=HOSTILE,
                          exe=f"/{i}/".ljust(3900, "x")) for i in range(29000))
        log = self.run_flood(itertools.chain(programs, honest("event", -10, "View")))
        self.assertTrue(any("beyond_image_limit: too many executables (user 1000, other)" in line for line in log), log[-5:])
        self.assert_clean(other.result(running))
        for machine in (self.machine, other):
            names = [name for name, _ in machine.rows()]
            self.assertEqual(names.count("ts__com.vantor.Honest__View__N"), 50)
            with open(os.path.join(machine.state, "last_run.json"), encoding="utf-8") as file:
                record = json.load(file)
            self.assertEqual(record["outcome"], "completed")
        lost = {loss["code"]: loss for loss in record["reading"]["losses"]}["beyond_time_limit"]
        self.assertEqual((lost["uid"], lost["count"]), (HOSTILE, 2000 - names.count("ts__com.vantor.Flood__View__N")))
        self.assertAlmostEqual(lost["count"], 2000 - 24 * 9 / 16 / 0.025, delta=20)

    def test_marked_floods_of_every_kind_in_one_store(self):
        """What is marked also costs rows and time. With 24 seconds a sixteenth is just enough for 50 objects."""
        def flood(i):
            text, long = ODD[i % len(ODD)], f"{i}-".ljust(4096, "v")
            common = {"at": -3600 + i * 0.001, "uid": HOSTILE, "exe": "/opt/" + text}
            yield point("event", "com.vantor.Flood", f"Category {i}", "N", **common)
            yield point("begin", "com.vantor.Flood", "Open", "N", interval=str(i), **common)
            yield point("begin", "com.vantor.Flood", "Open", "N", interval=f"again {i}", **common)
            yield point("event", text or "x", text[::-1] or "x", text, string1=(text, f"{i}{text}"), **common)
            if i % 20 == 0:
                yield point("event", "com.vantor.Flood", "Long", long, string1=(long, long[::-1]),
                            attributes=[(str(k), long[2 + k:]) for k in range(8)], **common)

        count = max(POINTS, MAX_OPEN_INTERVALS // 2 + 1000)
        floods = itertools.chain.from_iterable(map(flood, range(count)))
        self.run_flood(itertools.chain(honest("begin", -4000, "View"), floods, honest("end", -5, "View")), TESSEL_RUN_LIMIT="24")
        self.assertEqual([name for name, _ in self.machine.rows()].count("ts__com.vantor.Honest__View__N"), 50)
        with open(os.path.join(self.machine.state, "last_run.json"), encoding="utf-8") as file:
            record = json.load(file)
        self.assertEqual(record["outcome"], "completed")
        lost = {(loss["code"], loss["uid"]) for loss in record["reading"]["losses"] if "uid" in loss}
        self.assertEqual(lost, {("open_interval_dropped", HOSTILE), ("beyond_time_limit", HOSTILE)})

    def test_a_begin_pays_for_its_executable(self):
        def half(kind, first, i, **fields):
            return point(kind, "com.vantor.Honest", "View", "N", interval=str(i), scope="system", at=first + i * 0.001, **fields)

        begins = [half("begin", -50, i, uid=HOSTILE, exe=f"/{i}/".ljust(3900, "x")) for i in range(1500)]
        self.machine.write_export(begins + [half("end", -20, i, uid=HONEST) for i in range(1500)])
        summary = json.loads(self.assert_clean(self.machine.ctl("explain", "--summary", "--json")).out)
        self.assertEqual({loss["uid"] for loss in summary["over_share"]}, {HOSTILE})

    def test_text_for_the_spool_runs_out(self):
        long = [chr(1) * 4000 + str(i) for i in range(200)]  # six bytes of JSON for each character
        junk = (point("event", "com.vantor.Flood", "View", "N", string1=("a", value), at=-3600 + i * 0.001, uid=HOSTILE)
                for i, value in enumerate(long))
        self.machine.set_internal(True)
        log = self.run_flood(itertools.chain(junk, honest("event", -10, "View")), TESSEL_SPOOL_LIMIT=str(16 << 20))
        names = [name for name, _ in self.machine.rows()]
        self.assertEqual(names.count("ts__com.vantor.Honest__View__N"), 50)
        self.assertEqual(names.count("com.vantor.performance.tessel"), names.count("ts__com.vantor.Flood__View__N") + 50)
        self.assertLess(len(names), 2 * 50 + 2 * 50)
        self.assertTrue(any("beyond_text_limit: too much text for one run (user 1000, /opt/" in line for line in log))

    def test_every_value_is_new_and_as_long_as_may_be(self):
        count = POINTS // 10

        def entry(i):
            value = (str(i) + "-" * 4096)[:4096]
            return point("event", "com.vantor.Flood", "Long", value, telemetry=False, string1=(value, value),
                         string2=(value[::-1], value[::-1]), number1=("n", "9" * 4000),
                         attributes=[(str(k), value[2 + k:]) for k in range(8)], at=-3600 + i * 0.001)

        log = self.run_flood(map(entry, range(count)))
        self.assertEqual(self.statistics()["EventsNotReported"], count, log)

    def test_odd_text_in_every_field(self):
        def entry(i):
            text, other = ODD[i % len(ODD)], ODD[i // len(ODD) % len(ODD)]
            return point("event", text, other, f"{text}{i}", telemetry=False, string1=(other, f"{i}{text}"),
                         number1=(text, other), attributes=[(text, other)], exe="/opt/" + text, comm=other,
                         at=-3600 + i * 0.001)

        for line in self.run_flood(map(entry, range(POINTS))):
            assert_plain(self, line)
        self.assertEqual(self.statistics()["LogObjectsProcessed"], POINTS)


class Odd(MachineTest):
    """Strings that mean something to a terminal, a formatter, a shell, a parser or a database."""

    def entries(self):
        entries = []
        for number, text in enumerate(ODD):
            for field in ("SUBSYSTEM", "CATEGORY", "NAME", "STRING1_NAME", "STRING1_VALUE", "INTERVAL_ID", "DURATION",
                          "NUMBER1_VALUE", "FRAME_RATE", "KIND", "TELEMETRY", "ATTRIBUTE"):
                entry = point("event", "com.vantor.Odd", "C", f"N{number}", string1=("label", "week"),
                              number1=("n", "1"), exe="/opt/" + text, comm=text, at=-600 + len(entries) * 0.001)
                entry.fields = [pair for pair in entry.fields if pair[0] != "TESSEL_" + field]
                entry.fields.append(("TESSEL_" + field, text))
                entries.append(entry)
        entries.append(Entry([("MESSAGE", "\x1b[2J"), ("TESSEL_KIND", "event")], at=-1))
        return entries

    def run_odd(self, write, internal):
        self.machine.set_internal(internal)
        write(self.entries())
        result = self.run_clean()
        assert_plain(self, result.errors)
        self.assertFalse(any(line.startswith("error: forged") for line in result.errors.splitlines()))
        rows = self.machine.rows()
        self.assertGreater(len(rows), 50)
        for name, payload in rows:
            json.dumps([name, payload]).encode("utf-8")
        self.assertEqual(dict(rows[-1][1])["LogObjectsProcessed"], len(self.entries()))

    def test_from_an_export_file(self):
        self.run_odd(self.machine.write_export, internal=True)

    def test_from_a_journal_and_through_the_whitelist(self):
        self.run_odd(self.machine.write_journal, internal=False)


if __name__ == "__main__":
    harness.main()
