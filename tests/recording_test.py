#!/usr/bin/env python3
"""From `tesselctl record` and `logger --journald` through a real journal to what the service sends."""
import json
import os
import subprocess
import sys
import tempfile
import unittest

import harness
from harness import BIN, MachineTest

EVENT = "com.vantor.performance.tessel"
HERE = os.path.dirname(os.path.abspath(__file__))
CTL = os.path.join(BIN, "tesselctl")


def ctl(*arguments, **kwargs):
    return subprocess.run([CTL, *arguments], capture_output=True, text=True, check=False, **kwargs)


def sent(machine):
    """(kind, name) of each object that was sent, in order."""
    payloads = [dict(payload) for name, payload in machine.rows() if name == EVENT]
    return [(payload["IntervalType"], payload["Name"]) for payload in payloads]


def record_one_of_each(*where):
    """Records through every form of the command; answers what must be sent."""
    point = ("com.vantor.Calendar", "View")
    recorded = [
        ("event", *point, "Open", "--telemetry"),
        ("event", *point, "Unmarked"),
        ("begin", *point, "Draw", "--id", "7", "--telemetry"),
        ("begin", *point, "Slide", "--frame-rate", "60"),
        ("end", *point, "Draw", "--id", "8"),
        ("end", *point, "Draw", "--id", "7", "--attribute", "note=two\nlines"),
        ("end", *point, "Slide", "--telemetry"),
        ("end", *point, "Backwards", "--duration", "-1", "--telemetry"),
        ("event", *point, "Control\x1b[31m\nlines", "--telemetry"),
    ]
    for arguments in recorded:
        result = ctl("record", *arguments, *where)
        assert result.returncode == 0, (arguments, result.stderr)
    around = ctl("record", *where, "--subsystem", "com.vantor.Backup", "--category", "Job", "--name", "List",
                 "--telemetry", "--", "sh", "-c", "echo out; exit 7")
    assert (around.returncode, around.stdout) == (7, "out\n"), around
    return [("Event", "Open"), ("Interval", "Draw"), ("AnimationInterval", "Slide"),
            ("Event", "Control\x1b[31m\nlines"), ("Interval", "List")]


class Store(MachineTest):
    def test_an_export_file_is_delivered_as_recorded(self):
        expected = record_one_of_each("--store", self.machine.store)
        self.run_clean()
        self.assertEqual(sent(self.machine), expected)

    def test_the_journals_own_tools_take_the_file(self):
        expected = record_one_of_each("--store", self.machine.store)
        export = os.path.join(self.machine.store, "tessel.export")
        journal = os.path.join(self.machine.store, "converted.journal")
        subprocess.run([harness.REMOTE, "-o", journal, export], check=True, capture_output=True)
        os.unlink(export)
        self.run_clean()
        self.assertEqual(sent(self.machine), expected)

    def test_given_facts_replace_the_true_ones(self):
        common = ("--store", self.machine.store, "--boot", "ab" * 16, "--pid", "12", "--scope", "process")
        point = ("com.vantor.Calendar", "View", "Long", "--telemetry")
        self.assertEqual(ctl("record", "begin", *point, *common, "--ago", "100").returncode, 0)
        self.assertEqual(ctl("record", "end", *point, *common, "--ago", "40", "--comm", "other").returncode, 0)
        self.assertEqual(ctl("record", "event", *point, *common, "--ago", "90000").returncode, 0)
        with open(os.path.join(self.machine.store, "tessel.export"), encoding="utf-8") as file:
            self.assertEqual(file.read().count(f"\n_UID={os.getuid()}\n"), 3)
        self.run_clean()
        payloads = [dict(payload) for name, payload in self.machine.rows() if name == EVENT]
        self.assertEqual(len(payloads), 1)
        self.assertAlmostEqual(payloads[0]["DurationInSeconds"], 60, delta=10)


class CommandLine(unittest.TestCase):
    def test_what_cannot_be_recorded_is_named(self):
        with tempfile.TemporaryDirectory() as store:
            for arguments, status, named in (
                    (["record"], 2, "event, begin or end"),
                    (["record", "event", "s"], 2, "category"),
                    (["record", "event", "s", "c", "n" * 4097], 2, "TESSEL_NAME"),
                    (["record", "event", "s", "c", "--field", "F" * 65 + "=v"], 2, "F" * 65),
                    (["record", "event", "s", "c", "--field", "_PID=1"], 2, "_PID"),
                    (["record", "event", "s", "c", "--field", "lower=1"], 2, "lower"),
                    (["record", "event", "s", "c", "--number1", "n=1,5"], 2, "1,5"),
                    (["record", "event", "", "c"], 2, "TESSEL_SUBSYSTEM is empty"),
                    (["record", "event", "s", ""], 2, "TESSEL_CATEGORY is empty"),
                    (["record", "event", "s", "c", "--string1", "label"], 2, "LABEL=VALUE"),
                    (["record", "event", "s", "c", "--string1", "label="], 2, "TESSEL_STRING1_VALUE is empty"),
                    (["record", "event", "s", "c", "--number2", "=1"], 2, "TESSEL_NUMBER2_NAME is empty"),
                    (["record", "end", "s", "c", "--attribute", "k" * 65 + "=v"], 2, "65 bytes"),
                    (["record", "event", "s", "c", "--stdin"], 2, "--stdin"),
                    (["record", "event", "s", "c", "--duration", "1s"], 2, "1s"),
                    (["record", "end", "s", "c", "--attribute", "=v"], 2, "=v"),
                    (["record", "end", "s", "c", "--scope", "host"], 2, "scope"),
                    (["record", "event", "s", "c", "--boot", "x"], 2, "boot id"),
                    (["record", "event", "s", "c", "--", "true"], 2, "not both"),
                    (["record", "--", "true"], 2, "--subsystem"),
                    (["record", "--subsystem", "s", "--category", "c", "--", "/nowhere"], 127, "/nowhere"),
                    (["nonsense"], 2, "nonsense")):
                extra = ["--store", store] if arguments[0] == "record" else []
                at = arguments.index("--") if "--" in arguments else len(arguments)
                result = ctl(*arguments[:at], *extra, *arguments[at:])
                self.assertEqual(result.returncode, status, (arguments, result.stderr))
                self.assertIn(named, result.stderr, arguments)
            missing = os.path.join(store, "missing")
            self.assertEqual(ctl("record", "event", "s", "c", "--store", missing).returncode, 4)
            self.assertFalse(os.path.exists(missing))
        self.assertEqual(ctl("record", "event", "s", "c", "--pid", "1").returncode, 2)
        self.assertEqual(ctl("record", "--help").returncode, 0)


    def test_what_is_written(self):
        """The priority that keeps trace points out of a program's own limit, and no message unless asked for."""
        with tempfile.TemporaryDirectory() as store:
            where = ("--store", store)
            off = {**os.environ, "TESSEL_TRACE": "0"}
            self.assertEqual(ctl("record", "event", "s", "c", *where, env=off).returncode, 0)
            around = ctl("record", "--subsystem", "s", "--category", "c", *where, "--", "sh", "-c", "exit 3", env=off)
            lines = ctl("record", "--stdin", *where, env=off, input="nonsense\n")
            self.assertEqual((around.returncode, lines.returncode, lines.stderr, os.listdir(store)), (3, 0, "", []))
            absent = {**os.environ, "TESSEL_JOURNAL_SOCKET": "/nowhere"}
            around = ctl("record", "--subsystem", "s", "--category", "c", "--", "sh", "-c", "exit 3", env=absent)
            self.assertEqual((around.returncode, around.stderr.count("no journal is running")), (3, 1))
            ctl("record", "event", "s", "c", *where)
            ctl("record", "event", "s", "c", "--message", "asked for", "--field", "PRIORITY=5", *where)
            with open(os.path.join(store, "tessel.export"), encoding="utf-8") as file:
                plain, asked = file.read().split("\n\n")[:2]
            self.assertIn("\nPRIORITY=7\n", plain)
            self.assertNotIn("MESSAGE", plain)
            self.assertIn("\nMESSAGE=asked for\n", asked)
            self.assertEqual(asked.count("PRIORITY=5"), asked.count("PRIORITY="))

    def test_lines_of_json(self):
        """A line that is wrong is named by its number and costs no other; what lines lack comes from the options."""
        lines = ['{"name": "first"}', "", "nonsense", '{"nmae": "x"}', "[]", '{"name": 1}', '{"number1": {"n": 1e999}}',
                 '{"name": "%s"}' % ("x" * (1 << 21)), '{"kind": "none"}', '{"name": "a\\u0000b"}', '{"name": "last"}']
        with tempfile.TemporaryDirectory() as store:
            result = ctl("record", "--stdin", "--subsystem", "s", "--category", "c", "--store", store, input="\n".join(lines))
            with open(os.path.join(store, "tessel.export"), encoding="utf-8") as file:
                names = [line for line in file.read().splitlines() if line.startswith("TESSEL_NAME=")]
        self.assertEqual(names, ["TESSEL_NAME=first", "TESSEL_NAME=last"])
        said = [line.split(": ")[1] for line in result.stderr.splitlines()]
        self.assertEqual(said, [f"line {number}" for number in range(3, 11)] + ["8 of 10 lines were not recorded"])
        self.assertEqual(result.returncode, 2)
        self.assertEqual(ctl("record", "--stdin", "--", "true").returncode, 2)
        self.assertEqual(ctl("record", "--stdin", stdin=subprocess.DEVNULL).returncode, 0)


class Daemon(MachineTest):
    """Runs this script once more, beside a journal daemon of its own, for the tests of InsideDaemon."""

    def test_a_live_journal_is_delivered_as_recorded(self):
        result = subprocess.run([os.path.join(HERE, "with-journald"), sys.executable, os.path.abspath(__file__),
                                 "InsideDaemon"], capture_output=True, text=True, check=False, timeout=120)
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)


class InsideDaemon(MachineTest):
    def test_record_and_logger(self):
        expected = record_one_of_each()
        fields = ("MESSAGE=tessel\nTESSEL_KIND=event\nTESSEL_SUBSYSTEM=com.vantor.Calendar\nTESSEL_CATEGORY=View\n"
                  "TESSEL_NAME=Logged\nTESSEL_TELEMETRY=1\n")
        subprocess.run(["logger", "--journald"], input=fields, text=True, check=True)
        subprocess.run(["journalctl", "--sync"], check=True)  # the daemon may not have written the last entries yet
        self.run_clean(TESSEL_TRACE_STORE=None)
        self.assertEqual(sent(self.machine), expected + [("Event", "Logged")])
        self.log_to_the_journal(len(expected) + 1)

    def test_the_books_of_a_burst_that_lost_points_balance(self):
        """The program records two more points while it ends; a run and a look read the same journal."""
        burst = os.path.realpath(os.path.join(BIN, "trace_burst"))
        subprocess.run([burst, "10000"], check=True, stdout=subprocess.DEVNULL,
                       env=self.machine.environment(TESSEL_TRACE_WAIT="0"))
        subprocess.run(["journalctl", "--sync"], check=True)
        machine = {"TESSEL_TRACE_STORE": None}
        explain = ("explain", "--last", "1h", "--subsystem", "com.vantor.Calendar", "--summary")
        summary = json.loads(self.machine.ctl(*explain, "--json", **machine).out)
        points = next(pair for pair in summary["pairs"] if pair["category"] == "Burst")
        lost = summary["lost_at_source"]
        self.assertGreater(lost, 0, "nothing was lost: this proves nothing")
        self.assertEqual(points["telemetry_disabled"] + lost, 10_002)
        self.assertEqual(summary["lost_earlier"], 0)
        told = [loss for loss in summary["losses"] if loss["code"] == "lost_at_source"]
        self.assertEqual(sum(loss["count"] for loss in told), lost)
        # A daemon that lags behind reads the entries when the process has gone, and nobody knows the executable.
        self.assertLessEqual({(loss.get("uid"), loss["place"]) for loss in told}, {(0, burst), (None, "unknown")})
        self.assertIn(f"{told[0]['count']:,} lost_at_source: ", self.machine.ctl(*explain, **machine).out)
        self.run_clean(**machine)
        status = json.loads(self.machine.ctl("status", "--json", **machine).out)
        self.assertEqual(status["last_run"]["reading"]["lost_at_source"], lost)
        self.assertIn("lost_at_source", [note["code"] for note in status["notes"]])
        self.assertNotIn("lost_at_source", [problem["code"] for problem in status["problems"]])

    def log_to_the_journal(self, delivered):
        """A service that logs to the journal that it reads meets its own lines there: none is a trace point."""
        for run in (1, 2):
            result = self.run_clean(TESSEL_TRACE_STORE=None, TESSEL_LOG="journal")
            self.assertEqual(result.errors, "")
            self.assertEqual(len(sent(self.machine)), delivered * (run + 1))
        subprocess.run(["journalctl", "--sync"], check=True)
        output = subprocess.run(["journalctl", "-o", "json", "-t", "tessel_reporter"], check=True, capture_output=True)
        lines = [json.loads(line) for line in output.stdout.splitlines()]
        messages = [line["MESSAGE"].rstrip("\n") for line in lines if isinstance(line["MESSAGE"], str)]
        self.assertEqual(messages.count("Checking in"), 2)
        self.assertEqual(len([text for text in messages if text.startswith("Done processing ")]), 2)
        self.assertEqual(messages[-1], "Cleared cookie file")
        for line in lines:
            self.assertEqual((line["LOG_SUBSYSTEM"], line["LOG_CATEGORY"], line["PRIORITY"]),
                             ("com.vantor.TesselSupport", "tessel_reporter", "7"))
            self.assertEqual([key for key in line if key.startswith("TESSEL_")], [])


def load_tests(_loader, tests, _pattern):
    """Without names on the command line: all tests but InsideDaemon, which Daemon starts beside its daemon."""
    return unittest.TestSuite(suite for suite in tests if not any(isinstance(test, InsideDaemon) for test in suite))


if __name__ == "__main__":
    harness.main()
