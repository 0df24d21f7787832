#!/usr/bin/env python3
"""The service while its disk, its clock, its journal or its files fail, and after it was killed.

There are many places where a call can fail; by default the tests take a sample. TESSEL_FAULTS=all tries
every place. TESSEL_RANDOM_KILLS is the number of random moments at which the process is killed.
"""
import concurrent.futures
import contextlib
import errno
import os
import random
import shutil
import sqlite3
import subprocess
import time
import unittest

import harness
from harness import (BIN, STATISTICS, MachineTest, in_namespace_argv, interrupt, log_event, point, some_points,
                     wait_for)
from faults.fault_machine import BAILED, STEPS, FaultMachine, Watcher, is_subsequence

ALL = os.environ.get("TESSEL_FAULTS") == "all"
RANDOM_KILLS = int(os.environ.get("TESSEL_RANDOM_KILLS", "5"))
SAMPLE = 12 if harness.SANITIZED else 25
SPOOL = "statora.db"


def sampled(count):
    """Numbers from 1 to count: all, or the first few and a spread of the rest."""
    numbers = range(1, count + 1)
    if ALL or count <= SAMPLE:
        return list(numbers)
    return sorted({1, 2, 3, count, *random.Random(count).sample(numbers, SAMPLE)})


def each(machine_points, cases, check):
    """Runs check(machine, case) for each case on three machines at a time; making a machine costs a run."""
    machines = [FaultMachine(machine_points) for _ in range(3)]

    def work(index):
        for case in cases[index::len(machines)]:
            machines[index].forget_state()
            try:
                check(machines[index], case)
            except AssertionError as error:
                raise AssertionError(f"case {case}: {error}") from error

    try:
        with concurrent.futures.ThreadPoolExecutor(len(machines)) as pool:
            list(pool.map(work, range(len(machines))))
    finally:
        for machine in machines:
            machine.close()


class FaultTest(unittest.TestCase):
    assert_clean = MachineTest.assert_clean

    def machine(self, points):
        machine = FaultMachine(points)
        self.addCleanup(machine.close)
        return machine

    def assert_next_run_reports(self, machine):
        before = len(machine.stored())
        self.assert_clean(machine.run())
        self.assertEqual(machine.stored()[before:], machine.expected)
        self.assertFalse(machine.marker_exists())

    def assert_recovers(self, machine, marker):
        """After a kill that left a marker, the next run only removes the marker; the run after it is whole."""
        kept = machine.stored()
        self.assertEqual(kept, machine.expected[:len(kept)])
        self.assertEqual(machine.marker_exists(), marker)
        if marker:
            bailing = self.assert_clean(machine.run())
            self.assertIn(BAILED, bailing.log)
            self.assertEqual(machine.stored(), kept)
        self.assert_next_run_reports(machine)


class Disk(FaultTest):
    def check_spool(self, machine, case):
        at, error, times = case
        result = self.assert_clean(machine.run_struck_at(at, PATH=SPOOL, ERRNO=error, TIMES=times))
        self.assertFalse(machine.marker_exists())
        self.assertIn("Cleared cookie file", result.log)
        complaints = [line for line in result.log if line.startswith("Spool ")]
        self.assertLessEqual(len(complaints), 3, complaints)
        stored, record = machine.stored(), machine.record()
        self.assertTrue(is_subsequence(stored, machine.expected), "only what was sent may be there")
        lost = sum(record["rows_failed"].values())
        self.reasons |= {(error, reason) for reason, count in record["rows_failed"].items() if count}
        self.assertEqual(record["rows_stored"] + lost, len(machine.expected))
        self.assertGreaterEqual(len(stored), record["rows_stored"], "what is called stored is there")
        self.assertEqual(record["set_aside"], [], "a disk that fails is no damaged database")
        self.assertEqual(bool(complaints), lost > 0, "a loss is said, and nothing but a loss")
        if times == 1:
            # Rows whose flush failed count as lost, but a later reader finds them.
            self.assertEqual(stored, machine.expected, "one failed call costs no row")
        self.assert_next_run_reports(machine)

    def test_each_call_on_the_spool_may_fail(self):
        calls = self.machine(some_points(2)).count_calls(PATH=SPOOL)
        self.assertGreater(calls, 30, "the library must see the spool's calls")
        cases = [(at, error, times) for error, times in ((errno.ENOSPC, 0), (errno.EIO, 0), (errno.EIO, 1),
                                                         (errno.ENOSPC, 1)) for at in sampled(calls)]
        self.reasons = set()
        each(some_points(2), cases, self.check_spool)
        later = iter(range(calls // 2, calls))  # among them are the writes of rows, which a sample may miss
        while (errno.ENOSPC, "disk_full") not in self.reasons:
            each(some_points(2), [(next(later), errno.ENOSPC, 0)], self.check_spool)
        self.assertNotIn((errno.ENOSPC, "limit"), self.reasons)

    def test_a_checkpoint_that_fails_costs_its_rows_alone(self):
        """With the small limit each few transactions end with a checkpoint; a client's long log makes one at once."""
        machine = self.machine(some_points(60))
        for environment, log_rows, lost in (({"TESSEL_SPOOL_LIMIT": str(4 << 20)}, 0, 3), ({}, 60, 1)):
            machine.forget_state()
            self.assert_clean(machine.run(**environment))
            with contextlib.closing(sqlite3.connect(os.path.join(machine.state, "statora.db"))) as client:
                client.execute("PRAGMA wal_autocheckpoint=0")
                for _ in range(log_rows):
                    client.execute("INSERT INTO events(time, name, payload) VALUES(?, 'x', ?)",
                                   (int(time.time() * 1e6), "y" * 300000))
                    client.commit()
                result = self.assert_clean(machine.run_faulty(environment, PATH="statora.db-wal", CALL="fdatasync",
                                                              AT=1, TIMES=lost))
            self.assertIn("Cleared cookie file", result.log)
            record = machine.record()
            self.assertGreater(record["rows_failed"]["other"], 0, "the flush failed at a checkpoint")
            self.assertEqual(record["rows_stored"] + sum(record["rows_failed"].values()), len(machine.expected))
            self.assertFalse(machine.marker_exists())

    def test_the_other_files_of_the_state_may_fail_too(self):
        def check(machine, case):
            path, at, error = case
            result = machine.run_faulty({"TESSEL_DEFER_RETRY": "1"}, PATH=path, AT=at, ERRNO=error, TIMES=2)
            self.assertIn(result.status, (0, 73), result.errors)  # 73: a state directory that cannot be used
            self.assertTrue(is_subsequence(machine.stored(), machine.expected))
            self.assertFalse(machine.marker_exists())
            self.assert_next_run_reports(machine)

        cases = [(path, at, error) for path in ("/scheduler-last-run", "/last_run.json", "/state")
                 for at in (1, 2, 3) for error in (errno.EIO, errno.ENOSPC)]
        each(some_points(2), cases, check)

    def test_a_lock_that_fails_is_tried_again(self):
        """The service first tries the lock, then waits for it: two calls that fail are one failed attempt."""
        def check(machine, case):
            times, error = case
            result = self.assert_clean(machine.run_faulty({"TESSEL_DEFER_RETRY": "1"}, CALL="flock", PATH="/state",
                                                          AT=1, ERRNO=error, TIMES=times))
            complaints = [line for line in result.log if line.startswith("Could not lock the state directory")]
            self.assertEqual(len(complaints), times // 2, result.log)
            self.assertEqual(machine.stored(), machine.expected)
            self.assert_next_run_reports(machine)

        each(some_points(2), [(times, error) for times in (1, 2, 4) for error in (errno.EIO, errno.ENOLCK)], check)

    def test_a_marker_that_fails_costs_one_run_at_most(self):
        machine = self.machine(some_points(2))
        result = self.assert_clean(machine.run_faulty(PATH="tessel_reporter_running", AT=1, ERRNO=errno.ENOSPC, TIMES=1))
        self.assertIn("Could not create cookie file", result.log)
        self.assertEqual(machine.rows(), [])
        result = self.assert_clean(machine.run_faulty(PATH="tessel_reporter_running", AT=2, ERRNO=errno.EROFS))
        self.assertTrue(any(line.startswith("Could not clear cookie file") for line in result.log), result.log)
        self.assertTrue(any(line.startswith("The run marker could not be removed") for line in result.warnings))
        self.assert_recovers(machine, marker=True)

    def test_a_disk_without_room_ends_in_counted_losses(self):
        machine = self.machine(some_points(300))
        script = ('mount -n -t tmpfs -o size=512k none "$1" && { "$2"; status=$?; cp -a "$1"/. "$3"; '
                  'exit $status; }')
        kept = os.path.join(machine.root, "kept")
        os.mkdir(kept)
        result = subprocess.run(
            in_namespace_argv(machine.var_tmp, ["sh", "-c", script, "sh", machine.state,
                                                os.path.join(BIN, "tessel_reporter"), kept]),
            env=machine.environment(), capture_output=True, text=True, timeout=300, check=False)
        self.assertEqual(result.returncode, 0, result.stderr)
        machine.state = kept
        stored = machine.stored()
        self.assertGreater(len(stored), 50)
        self.assertLess(len(stored), len(machine.expected))
        self.assertTrue(is_subsequence(stored, machine.expected))
        said = [line for line in result.stderr.splitlines() if "does not take events" in line]
        self.assertEqual(len(said), 1, said)

    def test_a_state_directory_that_vanishes_in_the_middle(self):
        machine = self.machine(some_points(40))
        process = machine.start()
        wait_for(lambda: len(machine.rows()) > 10)
        self.assertIsNone(process.poll(), "the run must still be under way")
        shutil.rmtree(machine.state)
        self.assert_clean(machine.result(process))
        self.assertFalse(machine.marker_exists())
        machine.forget_state()
        self.assert_next_run_reports(machine)


class Clock(FaultTest):
    def test_a_day_back_or_forward_changes_nothing_sent(self):
        for seconds in (-86400, 86400):
            machine = self.machine(some_points(40))
            wrong = os.path.join(machine.root, "wrong")
            process = machine.start_faulty(CLOCK=wrong)
            wait_for(lambda: len(machine.rows()) > 10)  # pylint: disable=cell-var-from-loop
            before = time.monotonic()
            with open(wrong, "w", encoding="ascii") as file:
                file.write(str(seconds))
            self.assert_clean(machine.result(process))
            self.assertLess(time.monotonic() - before, 30, "pacing must not wait for the wall clock")
            self.assertEqual(machine.stored(), machine.expected)
            record = machine.record()
            self.assertAlmostEqual((record["end"] - record["start"]) / 1e6, seconds, delta=60)
            self.assert_next_run_reports(machine)

    def test_a_process_that_stays_runs_at_any_clock(self):
        machine = self.machine(some_points(1))
        wrong = os.path.join(machine.root, "wrong")

        def runs():
            return [name for name, _ in machine.rows()].count(STATISTICS)

        process = machine.start_faulty({"TESSEL_ACTIVITY_INTERVAL": "1"}, CLOCK=wrong)
        for seconds in (86400, -86400, 0):
            done = runs()
            wait_for(lambda: runs() > done + 1)  # pylint: disable=cell-var-from-loop
            with open(wrong, "w", encoding="ascii") as file:
                file.write(str(seconds))
        done = runs()
        wait_for(lambda: runs() > done + 1)
        interrupt(process)
        self.assertEqual(machine.result(process).status, 0)


class CutJournal(MachineTest):
    """A journal that is cut while a run that takes seconds reads it."""

    def setUp(self):
        super().setUp()
        # The reader holds less than this in memory, so a cut at the far end is still ahead of it. Each
        # filler is different: the journal would store equal ones once.
        filler = [log_event(random.Random(i).randbytes(4000).hex(), at=-500 + i * 0.001) for i in range(4000)]
        last = [point("event", "com.vantor.Calendar", "View", f"Last{i}", at=-10 + i * 0.01) for i in range(40)]
        self.path = self.machine.write_journal(some_points(40) + filler + last)

    def run_while_cut_to(self, size, complaint):
        process = self.machine.start()
        wait_for(lambda: len(self.machine.rows()) > 10)
        os.truncate(self.path, size)
        result = self.assert_clean(self.machine.result(process))
        self.assertFalse(self.machine.marker_exists())
        self.assertTrue(any(self.path in line and complaint in line for line in result.log), result.log[-20:])
        return dict(self.machine.rows()[-1][1])["EventsReported"]

    def test_cut_in_half_it_yields_the_first_half(self):
        self.assertEqual(self.run_while_cut_to(os.path.getsize(self.path) // 2, "cut short"), 40)

    def test_emptied_it_yields_what_was_read_before(self):
        self.assertLessEqual(self.run_while_cut_to(0, "entries missing"), 40)


class Permission(MachineTest):
    def test_files_without_permission_are_named(self):
        harness.require_root()
        for number in range(6):
            entries = [point("event", "com.vantor.Calendar", "View", f"Open{number}", at=-100 + number)]
            self.machine.write_export(entries, f"{number}.export", first_sequence=1 + number)
            os.chmod(os.path.join(self.machine.store, f"{number}.export"), 0o644 if number % 2 else 0o600)
        os.chmod(self.machine.root, 0o755)
        for folder in (self.machine.state, self.machine.var_tmp):
            os.chown(folder, 65534, 65534)
        command = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", os.path.join(BIN, "tessel_reporter")]
        result = subprocess.run(in_namespace_argv(self.machine.var_tmp, command), env=self.machine.environment(),
                                capture_output=True, text=True, timeout=120, check=False)
        self.assertEqual(result.returncode, 0, result.stderr)
        self.assertEqual(dict(self.machine.rows()[-1][1])["EventsReported"], 3)
        named = [line for line in result.stderr.splitlines() if "1 file_skipped: Permission denied" in line]
        self.assertEqual(len(named), 3, result.stderr)
        for number, line in zip((0, 2, 4), named):
            self.assertIn(f"{number}.export", line)
            self.assertIn("ermission denied", line)


class Kill(FaultTest):
    def test_at_every_named_step_of_a_run(self):
        def check(machine, case):
            line, marker = case
            self.assertEqual(machine.run_faulty(LINE=line).status, -9)
            self.assert_recovers(machine, marker)

        each(some_points(8), STEPS, check)

    def test_a_power_cut_at_each_call(self):
        """What was flushed is whole, in order, and part of what the kill has left."""
        def check(machine, at):
            watchers = []

            def watch():  # a run anew begins with an empty spool, so what was seen before does not count
                if watchers:
                    watchers.pop().end()
                watchers.append(Watcher(machine))
                watchers[0].start()

            result = machine.run_struck_at(at, watch, PATH=SPOOL, ERRNO=0, DURABLE=machine.durable)
            seen = watchers[0].end()
            self.assertEqual(result.status, -9)
            kept = machine.stored()
            self.assertGreaterEqual(len(kept), seen)
            machine.use_what_a_power_cut_leaves()
            survived = machine.stored()
            self.assertEqual(survived, kept[:len(survived)])
            self.assertEqual(survived, machine.expected[:len(survived)])
            self.assert_recovers(machine, marker=machine.marker_exists())

        calls = self.machine(some_points(2)).count_calls(PATH=SPOOL)
        each(some_points(2), sampled(calls), check)

    def test_a_power_cut_costs_the_last_second(self):
        machine = self.machine(some_points(240))
        process, watcher = machine.start_faulty(AT=10**9, PATH=SPOOL, DURABLE=machine.durable, SLOW=1), Watcher(machine)
        watcher.start()
        time.sleep(4)
        safe = watcher.seen
        time.sleep(1.8)  # a second, and what a busy machine adds
        process.kill()
        self.assertEqual(machine.result(process).status, -9)
        self.assertGreater(watcher.end(), safe)
        self.assertGreater(safe, 80)
        machine.use_what_a_power_cut_leaves()
        survived = machine.stored()
        self.assertEqual(survived, machine.expected[:len(survived)])
        self.assertGreaterEqual(len(survived), safe)

    def test_a_power_cut_after_a_run_costs_nothing(self):
        # The record is written twice: with the begin of the run, and behind its last row.
        calls = self.machine(some_points(8)).count_calls(PATH="last_run.json")
        self.assertEqual(calls % 2, 0)

        def check(machine, _):
            faults = {"PATH": "last_run.json", "AT": calls // 2 + 1, "ERRNO": 0, "DURABLE": machine.durable}
            self.assertEqual(machine.run_faulty(**faults).status, -9)
            machine.use_what_a_power_cut_leaves()
            self.assertEqual(machine.stored(), machine.expected)
            self.assert_recovers(machine, marker=False)

        each(some_points(8), [None], check)

    def test_at_random_moments(self):
        def check(machine, seed):
            status, delay = 0, random.Random(seed).random() * machine.duration
            while status != -9:  # a run that ended before the kill shows nothing: kill the next one earlier
                machine.forget_state()
                watcher = Watcher(machine)
                process = machine.start()
                watcher.start()
                time.sleep(delay)
                process.kill()
                status, seen, delay = machine.result(process).status, watcher.end(), delay / 2
            self.assertGreaterEqual(len(machine.stored()), seen)
            self.assert_recovers(machine, marker=machine.marker_exists())

        each(some_points(50), range(RANDOM_KILLS), check)


if __name__ == "__main__":
    harness.main()
