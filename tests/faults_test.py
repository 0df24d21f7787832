#!/usr/bin/env python3
"""The service while its disk, its clock, its journal or its files fail it, and after it was killed.

By default a sample is taken of the many places where something can go wrong; TESSEL_FAULTS=all tries
each, and TESSEL_RANDOM_KILLS says how many random moments the process is killed at.
"""
import concurrent.futures
import errno
import os
import random
import shutil
import subprocess
import sys
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
    """Runs check(machine, case) for each case, on a few machines at a time, each used again."""
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
        """What must follow a kill: one run that only clears up where there was a marker, then a whole one."""
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
        result = self.assert_clean(machine.run_faulty(PATH=SPOOL, AT=at, ERRNO=error, TIMES=times))
        self.assertFalse(machine.marker_exists())
        self.assertIn("Cleared cookie file", result.log)
        complaints = [line for line in result.log if line.startswith("Spool ")]
        self.assertLessEqual(len(complaints), 3, complaints)
        stored, record = machine.stored(), machine.record()
        self.assertTrue(is_subsequence(stored, machine.expected), "only what was sent may be there")
        lost = sum(record["rows_failed"].values())
        self.reasons |= {(error, reason) for reason, count in record["rows_failed"].items() if count}
        self.assertEqual(record["rows_stored"] + lost, len(machine.expected))
        # A row whose flush failed counts as lost, but may be found by the next to open the database.
        self.assertIn(len(stored) - record["rows_stored"], (0, 1), "what is called stored is there")
        self.assertEqual(record["set_aside"], [], "a disk that fails is no damaged database")
        self.assertEqual(bool(complaints), lost > 0, "a loss is said, and nothing but a loss")
        if times == 1:
            self.assertLessEqual(lost, 1, "one failed call costs one event")
        self.assert_next_run_reports(machine)

    def test_each_call_on_the_spool_may_fail_once_or_from_there_on(self):
        calls = self.machine(some_points(2)).count_calls(PATH=SPOOL)
        self.assertGreater(calls, 30, "the library must see the spool's calls")
        cases = [(at, error, times) for error, times in ((errno.ENOSPC, 0), (errno.EIO, 0), (errno.EIO, 1),
                                                         (errno.ENOSPC, 1)) for at in sampled(calls)]
        self.reasons = set()
        each(some_points(2), cases, self.check_spool)
        self.assertIn((errno.ENOSPC, "disk_full"), self.reasons)
        self.assertNotIn((errno.ENOSPC, "limit"), self.reasons)

    def test_the_other_files_of_the_state_may_fail_too(self):
        def check(machine, case):
            path, at, error = case
            result = machine.run(TESSEL_DEFER_RETRY="1", **machine.faults(PATH=path, AT=at, ERRNO=error, TIMES=2))
            self.assertIn(result.status, (0, 73), result.errors)  # 73: a state directory that cannot be used
            self.assertTrue(is_subsequence(machine.stored(), machine.expected))
            self.assertFalse(machine.marker_exists())
            self.assert_next_run_reports(machine)

        cases = [(path, at, error) for path in ("/lock", "/scheduler-last-run", "/last_run.json", "/state")
                 for at in (1, 2, 3) for error in (errno.EIO, errno.ENOSPC)]
        each(some_points(2), cases, check)

    def test_a_marker_that_cannot_be_made_is_no_run_and_one_that_cannot_be_removed_costs_one_run(self):
        machine = self.machine(some_points(2))
        result = self.assert_clean(machine.run_faulty(PATH="tessel_reporter_running", AT=1, ERRNO=errno.ENOSPC, TIMES=1))
        self.assertIn("Could not create cookie file", result.log)
        self.assertEqual(machine.rows(), [])
        result = self.assert_clean(machine.run_faulty(PATH="tessel_reporter_running", AT=2, ERRNO=errno.EROFS))
        self.assertTrue(any(line.startswith("Could not clear cookie file") for line in result.log), result.log)
        self.assert_recovers(machine, marker=True)

    def test_a_disk_without_room_ends_in_counted_losses(self):
        machine = self.machine(some_points(300))
        script = ('mount -t tmpfs -o size=1m none "$1" && { "$2"; status=$?; cp -a "$1"/. "$3"; '
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
        shutil.rmtree(machine.state)
        self.assert_clean(machine.result(process))
        self.assertFalse(machine.marker_exists())
        machine.forget_state()
        self.assert_next_run_reports(machine)


class Clock(FaultTest):
    def test_a_day_back_or_forward_in_the_middle_of_a_run_changes_nothing_that_is_sent(self):
        for seconds in (-86400, 86400):
            machine = self.machine(some_points(40))
            wrong = os.path.join(machine.root, "wrong")
            process = machine.start(**machine.faults(CLOCK=wrong))
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

    def test_a_process_that_stays_goes_on_running_however_the_clock_is_set(self):
        machine = self.machine(some_points(1))
        wrong = os.path.join(machine.root, "wrong")

        def runs():
            return [name for name, _ in machine.rows()].count(STATISTICS)

        process = machine.start(TESSEL_ACTIVITY_INTERVAL="1", **machine.faults(CLOCK=wrong))
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
        # Points at both ends of more than the reader keeps in memory; every filler is different.
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

    def test_cut_it_yields_what_came_before_the_cut_and_nothing_that_is_not_there(self):
        self.assertEqual(self.run_while_cut_to(os.path.getsize(self.path) // 2, "cut short"), 40)

    def test_emptied(self):
        self.assertLessEqual(self.run_while_cut_to(0, "entries missing"), 40)


class Permission(MachineTest):
    def test_files_that_may_not_be_read_are_named_and_the_others_are_reported(self):
        if os.geteuid() != 0:
            self.skipTest("only root can become a user who may not read")
        for number in range(6):
            entries = [point("event", "com.vantor.Calendar", "View", f"Open{number}", at=-100 + number)]
            self.machine.write_export(entries, f"{number}.export", first_sequence=1 + number)
            os.chmod(os.path.join(self.machine.store, f"{number}.export"), 0o644 if number % 2 else 0o600)
        os.chmod(self.machine.root, 0o755)
        for folder in (self.machine.state, self.machine.var_tmp):
            os.chmod(folder, 0o777)
        command = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", os.path.join(BIN, "tessel_reporter")]
        result = subprocess.run(in_namespace_argv(self.machine.var_tmp, command), env=self.machine.environment(),
                                capture_output=True, text=True, timeout=120, check=False)
        self.assertEqual(result.returncode, 0, result.stderr)
        self.assertEqual(dict(self.machine.rows()[-1][1])["EventsReported"], 3)
        named = [line for line in result.stderr.splitlines() if "was not read" in line]
        self.assertEqual(len(named), 3, result.stderr)
        for number, line in zip((0, 2, 4), named):
            self.assertIn(f"{number}.export", line)
            self.assertIn("ermission denied", line)


class Kill(FaultTest):
    def test_at_every_named_step_of_a_run(self):
        def check(machine, case):
            line, marker = case
            process = machine.start(**machine.faults(LINE=line))
            result = machine.result(process)
            self.assertEqual(result.status, -9, f"never said: {line}")
            self.assert_recovers(machine, marker)

        each(some_points(8), STEPS, check)

    def test_at_each_call_on_the_spool_a_power_cut_costs_no_row_that_was_followed_by_another(self):
        def check(machine, at):
            watcher = Watcher(machine)
            watcher.start()
            result = machine.run_faulty(PATH=SPOOL, AT=at, ERRNO=0, DURABLE=machine.durable)
            seen = watcher.end()
            kept = machine.stored()
            if result.status == 0 and at > calls // 2:
                # The watcher had the spool open at the end: then the service leaves out the last of its calls,
                # which tidy up.
                self.assertEqual(kept, machine.expected)
                return
            self.assertEqual(result.status, -9)
            self.assertGreaterEqual(len(kept), seen)
            machine.use_what_a_power_cut_leaves()
            survived = machine.stored()
            self.assertEqual(survived, machine.expected[:len(survived)])
            self.assertGreaterEqual(len(survived), len(kept) - 1)
            self.assert_recovers(machine, marker=machine.marker_exists())

        calls = self.machine(some_points(2)).count_calls(PATH=SPOOL)
        each(some_points(2), sampled(calls), check)

    def test_at_random_moments(self):
        def check(machine, seed):
            watcher = Watcher(machine)
            process = machine.start()
            watcher.start()
            time.sleep(random.Random(seed).random() * 1.8)
            process.kill()
            machine.result(process)
            seen = watcher.end()
            self.assertGreaterEqual(len(machine.stored()), seen)
            if machine.stored() == machine.expected and not machine.marker_exists():
                return  # it was done
            self.assert_recovers(machine, marker=machine.marker_exists())

        each(some_points(50), range(RANDOM_KILLS), check)


if __name__ == "__main__":
    if not os.path.exists(os.path.join(BIN, "fault_shim.so")):
        print("skipped: fault_shim.so was not built")
        sys.exit(harness.SKIPPED)
    harness.main()
