#!/usr/bin/env python3
"""What stands in the state directory, who may use it, and limits on files: none of them silences the service."""
import json
import os
import re
import sqlite3
import subprocess

import harness
from harness import STATISTICS, Entry, MachineTest, in_namespace_argv, interrupt, point, some_points, wait_for

NOBODY = ("setpriv", "--reuid=65534", "--regid=65534", "--clear-groups")


class StateTest(MachineTest):
    def run_under(self, *command, **environment):
        """A run behind a command that sets limits or the user. Its lines go to a pipe, which no limit concerns."""
        program = os.path.join(harness.BIN, "tessel_reporter")
        return subprocess.run(in_namespace_argv(self.machine.var_tmp, [*command, program]), text=True, check=False,
                              env=self.machine.environment(**environment), capture_output=True, timeout=60)

    def state(self, name):
        return os.path.join(self.machine.state, name)

    def record(self):
        with open(self.state("last_run.json"), encoding="utf-8") as file:
            return json.load(file)

    def statistics(self):
        return [dict(payload) for name, payload in self.machine.rows() if name == STATISTICS]


class Names(StateTest):
    def test_a_pipe_under_any_name_hangs_nothing(self):
        self.machine.write_export(some_points(2))
        names = ("last_run.json", "scheduler-last-run", "scheduler-put-off")
        for name in names:
            os.mkfifo(self.state(name))
            os.mkfifo(self.state(name + ".new"))
        status = self.machine.result(self.machine.start("tesselctl", "status"), timeout=20)
        self.assertEqual(status.status, 0, status.errors)
        told = json.loads(self.machine.ctl("status", "--json").out)["refused_files"]
        self.assertEqual([text.split(": ", 1)[1] for text in told], ["it is no regular file"] * 3)
        self.assertEqual(re.sub(r"\s+", " ", status.out).count(": it is no regular file"), 3, status.out)
        result = self.assert_clean(self.machine.result(self.machine.start(), timeout=20))
        for name in names:
            refused = f"A file in the state directory is not used: {self.state(name)}: it is no regular file"
            self.assertEqual(result.warnings.count(refused), 1, result.errors)
        self.assertEqual(self.record()["outcome"], "completed")
        # Nothing was put off, so nothing was written under the last name.
        self.assertEqual(self.assert_clean(self.machine.result(self.machine.start(), timeout=20)).warnings, [refused])

    def test_another_user_than_the_owner_is_refused(self):
        harness.require_root()
        os.chmod(self.machine.root, 0o755)
        os.chmod(self.machine.state, 0o2777)
        result = self.run_under(*NOBODY)
        self.assertEqual((result.returncode, len(result.stderr.splitlines())), (73, 1), result.stderr)
        self.assertIn("it belongs to user 0, and this process runs as user 65534", result.stderr)
        os.chown(self.machine.state, 65534, 65534)
        self.assertEqual(self.machine.run().status, 73, "root by hand")
        self.assertEqual(os.listdir(self.machine.state), [], "nothing may be written")
        os.chmod(self.machine.var_tmp, 0o1777)
        self.machine.write_export(some_points(2))
        self.assertEqual(self.run_under(*NOBODY).returncode, 0)
        self.assertEqual(self.statistics()[0]["EventsReported"], 2)


class Limits(StateTest):
    def test_too_few_descriptors_are_said(self):
        self.machine.write_export(some_points(2))
        result = self.run_under("prlimit", "--nofile=6:6")
        self.assertEqual((result.returncode, len(result.stderr.splitlines())), (71, 1), result.stderr)
        self.assertIn("RLIMIT_NOFILE) is 6, and the service needs 32", result.stderr)
        self.assertEqual(os.listdir(self.machine.state), [], "nothing may be written")
        self.assertEqual(self.run_under("prlimit", "--nofile=6:1024").returncode, 0)
        self.assertEqual(self.statistics()[0]["EventsReported"], 2)

    def test_a_store_leaves_descriptors_for_the_spool(self):
        for number in range(60):
            self.machine.write_export([point("event", "com.vantor.Calendar", "View", f"Open{number}", at=-60)],
                                      f"{number}.export", first_sequence=1 + number)
        self.assertEqual(self.run_under("prlimit", "--nofile=32:32").returncode, 0)
        record = self.record()
        self.assertEqual(sum(record["rows_failed"].values()), 0, record)
        self.assertEqual((record["marker"], self.machine.marker_exists()), ("removed", False))
        losses = {loss["code"]: loss["count"] for loss in record["reading"]["losses"]}
        self.assertEqual(losses["files_not_looked_at"] + record["reading"]["files_read"], 60)


    def test_a_limit_on_file_size_costs_rows_and_no_run(self):
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", f"{i}" + 2000 * "x") for i in range(60)])
        result = self.run_under("prlimit", "--fsize=65536")
        self.assertEqual(result.returncode, 0, result.stderr)
        record = self.record()
        self.assertGreater(sum(record["rows_failed"].values()), 0)
        self.assertEqual(record["rows_stored"] + sum(record["rows_failed"].values()), 2 * 60 + 4)
        self.assertEqual((record["outcome"], record["marker"]), ("completed", "removed"))
        result = self.run_under("prlimit", "--fsize=1")
        self.assertEqual((result.returncode, self.machine.marker_exists()), (0, False), result.stderr)
        self.assertIn("warning: The record of the run is not written: ", result.stderr)
        self.assertEqual(self.record(), record)


class Warnings(StateTest):
    def warnings_of_a_run(self, **environment):
        return self.run_clean(TESSEL_LOG_LEVEL="error", **environment).warnings

    def test_each_reason_is_one_line_at_every_level(self):
        malformed = [Entry([("TESSEL_KIND", "event"), ("TESSEL_SUBSYSTEM", f"\x1b[31m{i}\n")], exe=f"/w/{i}\n")
                     for i in range(20)]
        self.machine.write_export(some_points(2) + malformed)
        self.assertEqual(len(self.warnings_of_a_run()), 1)
        with open(os.path.join(self.machine.store, "b\n.journal"), "wb") as file:
            file.write(bytes(1 << 16))
        os.unlink(self.state("statora.db"))
        with sqlite3.connect(self.state("statora.db")) as database:
            database.execute("PRAGMA user_version = 99")
        rows, files, points = self.warnings_of_a_run()
        self.assertEqual(rows, "The spool refused rows of the run: 8 of 8, reason version")
        self.assertRegex(files, r"^Files of the trace store were not read: 1; the first: .*/b\\x0a\.journal\)$")
        self.assertRegex(points, r"^Trace points were malformed: 20; the first: [ -~]+$")

    def test_a_run_that_does_not_report_says_why(self):
        missing = os.path.join(self.machine.root, "nowhere")
        line, = self.warnings_of_a_run(TESSEL_TRACE_STORE=missing)
        self.assertTrue(line.startswith(f"The run failed: {missing}"), line)
        open(os.path.join(self.machine.var_tmp, harness.MARKER), "wb").close()
        line, = self.warnings_of_a_run()
        self.assertTrue(line.startswith("The run read nothing, because an earlier run died"), line)
        os.chmod(self.machine.var_tmp, 0o500)
        self.machine.read_only.append("/var/tmp")
        line, = self.warnings_of_a_run()
        self.assertEqual(line, "The run failed: the run marker could not be made: /var/tmp/tessel_reporter_running: "
                               "Read-only file system")


class BuildVariant(StateTest):
    def test_a_process_that_stays_follows_the_file(self):
        self.machine.set_internal(True)
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", string1=("period", "my secret"))] * 4)
        process = self.machine.start(TESSEL_ACTIVITY_INTERVAL="2")
        wait_for(lambda: self.statistics())
        self.machine.set_internal(False)
        wait_for(lambda: len(self.statistics()) > 1)
        interrupt(process)
        self.assert_clean(self.machine.result(process))
        books = self.statistics()
        self.assertEqual([book["EventsReported"] for book in books[:2]], [4, 0])


if __name__ == "__main__":
    harness.main()
