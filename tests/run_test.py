#!/usr/bin/env python3
"""Whole runs over a real journal: compares every row of the spool and every line of the log."""
import datetime
import os
import re
import subprocess
import time

import harness
from harness import MachineTest
from mixed_day import mixed_day
from model import DISABLED, DURATION, REPORTED, Rules, Run

OUR_OWN_LINES = re.compile(r"^(Deferral not requested, continuing\.|Sleeping for \d+ us)$")


def root_filesystem():
    return subprocess.run(["findmnt", "-n", "-o", "FSTYPE", "/"], check=True, capture_output=True,
                          text=True).stdout.split()[-1]


def normal(line):
    line = re.sub(r" in \d+\.\d\ds between .*? and [^(]*?(?=( \(Interrupted|$))", " in Ns between DATE and DATE", line)
    return re.sub(r"^Throttled \d+ times for a total of \d+ usec$", "Throttled", line)


class MixedDay(MachineTest):
    def setUp(self):
        super().setUp()
        self.entries, self.bundles = mixed_day(self.machine)
        self.filesystem = root_filesystem()

    def expected(self, **rules):
        return Run(self.entries, Rules(**rules), self.bundles, self.filesystem)

    def assert_rows(self, expected):
        rows = self.machine.rows()
        name, statistics = rows[-1]
        # As text, because Python takes 5 and 5.0 for equal.
        self.assertEqual([*map(repr, rows[:-1])], [*map(repr, expected.object_rows + expected.count_rows())])
        self.assertEqual(name, "com.vantor.performance.tessel_reporting_stats")
        self.assertEqual(statistics[0][0], "ProcessingDurationInSeconds")
        self.assertEqual(statistics[1:], expected.statistics())

    def object_log(self, expected):
        """The log lines of deciding and sending, for each object in order."""
        lines, set_built, throttled, found = [], False, False, set()
        for thing, verdict in expected.judged:
            if verdict in (DISABLED, DURATION):
                continue
            lines.append("Defaulting to using string whitelist")
            if not set_built and (thing.get("STRING1_NAME") or thing.get("STRING2_NAME")):
                lines.append("Using string whitelist with 327 elements for Selvin platform")
                set_built = True
            if verdict != REPORTED:
                continue
            override = thing.attributes.get("BundleIdOverride")
            overridden = thing.kind != "Event" and override and (
                thing.pair[0] == "com.vantor.morvald" or thing.pair == ("com.vantor.Harrowmere", "Snapshot"))
            if overridden:
                lines.append("{}/{}/{}: Overriding bundle ID to {}".format(*thing.path, override))
            else:
                for entry in dict.fromkeys((thing.begin, thing.end)):
                    if entry.exe in self.bundles and entry.exe not in found:
                        found.add(entry.exe)
                        lines.append(f'Found bundle ID: "{self.bundles[entry.exe]}" for path:"{entry.exe}"')
            if not throttled:
                throttled = True
                lines.append("125000.000000 us, 125000000.000000 mach time units per quantum of 10 reported events")
        return lines

    def test_spool_and_log_are_what_the_points_yield(self):
        self.machine.write_journal(self.entries)
        result = self.run_clean()
        expected = self.expected()
        self.assert_rows(expected)
        self.assertFalse(self.machine.marker_exists())
        wanted = (["Checking in", "Reporting based on being tasked-on by Statora", "Created cookie file",
                   f"Filesystem for '/': {self.filesystem}", "Boot disk type: SSD"] +
                  self.object_log(expected) + expected.summary_log() +
                  [expected.closing_line("N"), "Throttled", "Cleared cookie file"])
        got = [normal(line) for line in result.log if not OUR_OWN_LINES.match(line)]
        self.assertEqual(got, wanted)
        self.assertIn("Deferral not requested, continuing.", result.log)
        sleeps = [int(line.split()[2]) for line in result.log if line.startswith("Sleeping for")]
        throttled = [line for line in result.log if line.startswith("Throttled")]
        self.assertEqual(throttled, [f"Throttled {len(sleeps)} times for a total of {sum(sleeps)} usec"])

    def test_internal_builds_need_no_tasking_or_whitelist(self):
        self.machine.set_internal(True)
        self.machine.task('{"TaskedOn": false}')
        self.machine.write_journal(self.entries)
        result = self.run_clean()
        self.assert_rows(self.expected(internal=True))
        self.assertIn("Reporting based on os_flavor result", result.log)

    def test_the_log_level_changes_nothing_that_is_sent(self):
        self.machine.write_export(self.entries)
        result = self.run_clean(TESSEL_LOG_LEVEL="error")
        self.assertEqual(result.log, [])
        self.assert_rows(self.expected())

    def test_the_zone_of_the_dates_may_be_a_rule(self):
        lines = self.run_clean(TZ="XYZ-5:30").log
        [date] = [found.group(1) for line in lines if (found := re.search(r" between (.*?) and ", line))]
        at = datetime.datetime.strptime(date.replace("\u202f", " "), "%m/%d/%y, %I:%M:%S %p")
        there = datetime.datetime.utcfromtimestamp(time.time()) + datetime.timedelta(hours=5.5 - 24)
        self.assertLess(abs(there - at), datetime.timedelta(minutes=2))

    def test_without_a_journal_lines_go_to_stderr(self):
        without_journal = "[ ! -d /run/systemd/journal ] || mount -n -t tmpfs none /run/systemd/journal; exec $0"
        command = ["sh", "-c", without_journal, os.path.join(harness.BIN, "tessel_reporter")]
        result = subprocess.run(harness.in_namespace_argv(self.machine.var_tmp, command), text=True, check=True,
                                env=self.machine.environment(TESSEL_LOG="journal"), capture_output=True)
        self.assertIn("debug: Checking in\n", result.stderr)


class NotTasked(MachineTest):
    def test_without_a_configuration_it_sends_nothing(self):
        self.machine = harness.Machine()
        self.addCleanup(self.machine.close)
        self.machine.write_export([harness.point("event", "com.vantor.Calendar", "View", "Open")])
        result = self.run_clean()
        self.assertEqual(result.log, ["Checking in",
                                      "Not reporting based on not being tasked-on by Statora (Timeout waiting for config)"])
        self.assertEqual(self.machine.rows(), [])
        self.assertFalse(self.machine.marker_exists())


if __name__ == "__main__":
    harness.main()
