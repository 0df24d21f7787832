#!/usr/bin/env python3
"""The life of the process: launch configuration, check-in, deferral, interrupt, two processes at a time."""
import os
import random
import sqlite3
import time

import harness
from harness import STATISTICS, Machine, MachineTest, interrupt, point, some_points, wait_for


class Launch(MachineTest):
    def test_a_senseless_value_is_one_line_and_status_78(self):
        os.rmdir(self.machine.state)
        result = self.machine.run(TESSEL_DEFER_RETRY="15m")
        self.assertEqual(result.status, 78)
        self.assertEqual(len(result.errors.splitlines()), 1, result.errors)
        self.assertIn('TESSEL_DEFER_RETRY="15m"', result.errors)
        self.assertFalse(os.path.exists(self.machine.state), "nothing may be written")

    def test_arguments_are_ignored(self):
        self.assert_clean(self.machine.result(self.machine.start("tessel_reporter", "--help", "x")))

    def test_an_unreadable_store_is_named_with_its_reason(self):
        absent = os.path.join(self.machine.root, "nowhere")
        noise = os.path.join(self.machine.root, "noise.journal")
        with open(noise, "wb") as file:
            file.write(random.Random(1).randbytes(1 << 20))
        for path in (absent, noise):
            result = self.run_clean(TESSEL_TRACE_STORE=path)
            failures = [line for line in result.log if line.startswith("Failed to process tessel data due to error: ")]
            self.assertEqual(len(failures), 1, result.log)
            self.assertIn(path, failures[0])
            self.assertEqual(self.machine.rows()[-1][0], STATISTICS)
            self.assertFalse(self.machine.marker_exists())

    def test_an_unwritable_state_directory_costs_events(self):
        self.machine.write_journal(some_points(3))
        self.machine.read_only.append(self.machine.state)
        result = self.run_clean()
        for beginning in ("Spool ", "Could not record the run: "):
            said = [line for line in result.log if line.startswith(beginning)]
            self.assertEqual(len(said), 1, result.log)
            self.assertIn(self.machine.state, said[0])
        self.assertTrue(any(line.startswith("Done processing 3 reported") for line in result.log), result.log)
        self.assertEqual(os.listdir(self.machine.state), [])
        self.assertFalse(self.machine.marker_exists())

class Deferral(MachineTest):
    def test_a_run_that_should_defer_is_offered_again(self):
        self.machine.write_journal(some_points(1))
        wish = os.path.join(self.machine.state, "defer")
        open(wish, "w", encoding="utf-8").close()
        process = self.machine.start(TESSEL_DEFER_RETRY="1")
        time.sleep(2.5)
        self.assertIsNone(process.poll())
        os.unlink(wish)
        result = self.assert_clean(self.machine.result(process))
        self.assertEqual(result.log[:2], ["Checking in", "Deferred tessel_reporter"])
        self.assertEqual(self.machine.rows()[-1][0], STATISTICS)

    def test_the_defer_file_and_the_run_limit_stop_a_run(self):
        """Either ends a run well: what was read is reported and summed up, and the marker is gone."""
        limited = Machine()
        self.addCleanup(limited.close)
        limited.task()
        deferred = self.machine
        for machine in (deferred, limited):
            machine.write_journal(some_points(3000))
        processes = [deferred.start(TESSEL_RUN_LIMIT="0"), limited.start(TESSEL_RUN_LIMIT="3")]
        wait_for(deferred.rows)
        wish = os.path.join(deferred.state, "defer")
        open(wish, "w", encoding="utf-8").close()
        for machine, process, reason in ((deferred, processes[0], f"{wish} exists"),
                                         (limited, processes[1], "it has taken as long as TESSEL_RUN_LIMIT allows")):
            result = self.assert_clean(machine.result(process))
            rows = machine.rows()
            statistics = dict(rows[-1][1])
            self.assertTrue(statistics["WasInterrupted"])
            self.assertLess(statistics["EventsReported"], 3000)
            self.assertEqual(sum(name == "com.vantor.performance.tessel" for name, _ in rows), statistics["EventsReported"])
            self.assertTrue(any(line.endswith(" (Interrupted by deferral)") for line in result.log))
            why, what = result.warnings
            self.assertEqual(why, f"The run is stopped early: {reason}")
            self.assertTrue(what.startswith("The run was cut short"), what)
            self.assertEqual(machine.record()["outcome"], "interrupted")
            self.assertFalse(machine.marker_exists())

    def test_pressure_puts_a_run_off_for_a_time_and_never_stops_it(self):
        self.machine.write_journal(some_points(30))
        pressure = os.path.join(self.machine.root, "cpu")
        with open(pressure, "w", encoding="utf-8") as file:
            file.write("some avg10=99.00 avg60=99.00 avg300=99.00 total=1\n")
        process = self.machine.start("/bin/sh", "-c", 'mount -n --bind "$0" /proc/pressure/cpu && exec "$@"', pressure,
                                     os.path.join(harness.BIN, "tessel_reporter"),
                                     TESSEL_DEFER_ON="pressure", TESSEL_DEFER_LIMIT="3", TESSEL_DEFER_RETRY="2")
        result = self.assert_clean(self.machine.result(process, 60))
        self.assertEqual(result.log.count("Deferred tessel_reporter"), 2)
        self.assertEqual(result.warnings, ["The run is put off: the CPU is under pressure"])
        statistics = dict(self.machine.rows()[-1][1])
        self.assertEqual((statistics["EventsReported"], statistics["WasInterrupted"]), (30, False))


class FileSize(MachineTest):
    def test_a_file_that_may_not_grow_costs_rows_alone(self):
        self.machine.write_journal(some_points(300))
        process = self.machine.start("/usr/bin/prlimit", "--fsize=300000", os.path.join(harness.BIN, "tessel_reporter"),
                                     TESSEL_LOG_LEVEL="error")
        self.assert_clean(self.machine.result(process))
        self.assertFalse(self.machine.marker_exists())
        record = self.machine.record()
        self.assertGreater(sum(record["rows_failed"].values()), 0, record)


class TwoProcesses(MachineTest):
    def test_the_second_process_runs_after_the_first(self):
        self.machine.write_journal(some_points(60))
        first = self.machine.start()
        wait_for(self.machine.marker_exists)
        second = self.machine.start()
        results = [self.machine.result(process) for process in (first, second)]
        for result in results:
            self.assert_clean(result)
            self.assertNotIn("Bailing due to cookie file", result.log)
        names = [name for name, _ in self.machine.rows()]
        ends = [position for position, name in enumerate(names) if name == STATISTICS]
        self.assertEqual(len(ends), 2)
        self.assertEqual(ends[0], len(names) // 2 - 1, "the runs must not mix")


class TwoRuns(MachineTest):
    def test_what_a_process_keeps_from_run_to_run(self):
        thinned = [point("event", "com.vantor.TextInput", "Key", "Press", string1=("period", "week"), at=-300 + i * 0.01)
                   for i in range(300)]
        self.machine.write_journal(some_points(10) + thinned)
        process = self.machine.start(TESSEL_ACTIVITY_INTERVAL="1")
        wait_for(lambda: [name for name, _ in self.machine.rows()].count(STATISTICS) >= 2)
        interrupt(process)
        result = self.assert_clean(self.machine.result(process))
        books = [dict(payload) for name, payload in self.machine.rows() if name == STATISTICS]
        self.assertEqual([book["EventsReported"] for book in books[:2]], [10, 11], "the 503rd object is in the second")
        throttled = [int(line.split()[1]) for line in result.log if line.startswith("Throttled ")]
        self.assertEqual(sorted(set(throttled)), throttled, "the totals of the process")
        for once in ("Checking in", "Using string whitelist with 327 elements for Selvin platform",
                     "125000.000000 us, 125000000.000000 mach time units per quantum of 10 reported events"):
            self.assertEqual(result.log.count(once), 1, once)


class Interrupt(MachineTest):
    def test_it_ends_with_0_at_once_whatever_is_going_on(self):
        self.machine.write_journal(some_points(400))
        slack = 2.0 if harness.SANITIZED else 1.0
        for attempt in range(10):
            process = self.machine.start()
            wait_for(lambda running=process: os.fstat(running.tessel_errors.fileno()).st_size)
            time.sleep(random.Random(attempt).random() * 1.5)
            before = time.monotonic()
            interrupt(process)
            result = self.machine.result(process)
            self.assertEqual(result.status, 0, result.errors)
            self.assertLess(time.monotonic() - before, slack)


class Pacing(MachineTest):
    def test_no_ten_sends_are_closer_than_a_quantum(self):
        self.machine.write_journal(some_points(100))
        process = self.machine.start()
        self.assert_clean(self.machine.result(process))
        with sqlite3.connect(os.path.join(self.machine.state, "statora.db")) as database:
            times = [row[0] for row in database.execute("SELECT time FROM events ORDER BY id")]
        # The service paces the moment at which it queues ten sends. Each send itself may run a little later.
        span = times[199] - times[9]
        self.assertGreater(span, 125_000 * 18, "19 quanta of ten sends")


if __name__ == "__main__":
    harness.main()
