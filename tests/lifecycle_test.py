#!/usr/bin/env python3
"""The life of the process: launch configuration, check-in, deferral, interrupt, watchdog, limits of the system,
two processes at a time."""
import contextlib
import os
import random
import signal
import socket
import sqlite3
import time

import harness
from harness import STATISTICS, Machine, MachineTest, interrupt, point, some_points, wait_for
from faults.fault_machine import FaultMachine


def endless_journal(machine, points):
    """A journal file that only a newer journalctl can read, and a journalctl that prints the points and then nothing
    more, without an end. Answers the environment in which it is found."""
    path = machine.write_journal(some_points(1))
    with open(path, "r+b") as file:
        file.seek(15)  # among the flags that a reader must know
        file.write(b"\x40")
    tools = os.path.join(machine.root, "tools")
    os.mkdir(tools)
    with open(os.path.join(tools, "points"), "wb") as file:
        file.writelines(harness.export_bytes(points, machine.now))
    with open(os.path.join(tools, "journalctl"), "w", encoding="utf-8") as file:
        file.write(f"#!/bin/sh\nexec tail --pid=$PPID --lines=+1 -f {tools}/points\n")
    os.chmod(file.name, 0o755)
    return {"PATH": tools + ":" + os.environ["PATH"]}


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
        deferred, limited = self.machine, Machine()
        self.addCleanup(limited.close)
        limited.task()
        deferred.write_journal(some_points(3000))
        tools = endless_journal(limited, some_points(20))
        processes = [deferred.start(TESSEL_RUN_LIMIT="0"), limited.start(TESSEL_RUN_LIMIT="3", **tools)]
        wait_for(deferred.rows)
        wish = os.path.join(deferred.state, "defer")
        open(wish, "w", encoding="utf-8").close()
        for machine, process, most, reason in (
                (deferred, processes[0], 2999, f"{wish} exists"),
                (limited, processes[1], 20, "it has taken as long as TESSEL_RUN_LIMIT allows")):
            result = self.assert_clean(machine.result(process))
            rows = machine.rows()
            statistics = dict(rows[-1][1])
            self.assertTrue(statistics["WasInterrupted"], result.errors)
            self.assertIn(statistics["EventsReported"], range(1, most + 1))
            self.assertEqual(sum(name == "com.vantor.performance.tessel" for name, _ in rows), statistics["EventsReported"])
            self.assertTrue(any(line.endswith(" (Interrupted by deferral)") for line in result.log))
            self.assertEqual(result.warnings[0], f"The run is stopped early: {reason}")
            self.assertTrue(any(line.startswith("The run was cut short") for line in result.warnings), result.warnings)
            self.assertEqual(machine.record()["outcome"], "interrupted")
            self.assertFalse(machine.marker_exists())

    def test_pressure_puts_a_run_off_and_never_stops_it(self):
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


class Watchdog(MachineTest):
    def test_a_wait_is_a_sign_of_life_for_a_minute(self):
        """Reading hangs in a journalctl that never answers. The clocks are hurried on, so a minute is soon over."""
        tools = endless_journal(self.machine, [])
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as manager:
            manager.bind(os.path.join(self.machine.root, "notify"))
            manager.settimeout(60)
            process = self.machine.start(**FaultMachine.faults(HURRY="1"), **tools,
                                         NOTIFY_SOCKET=manager.getsockname(), WATCHDOG_USEC="15000000")
            self.addCleanup(process.kill)
            while manager.recv(4096) != b"STATUS=reading the trace store":
                pass
            manager.settimeout(6)  # the first wait of the main loop is too long to be hurried; all others are
            signs = 0
            with contextlib.suppress(TimeoutError):
                while signs < 60:
                    signs += manager.recv(4096) == b"WATCHDOG=1"
        self.assertIsNone(process.poll())
        # One each 3.75 s for a minute, after those of the progress before. Hurried clocks make that many on a slow machine.
        self.assertIn(signs, range(13, 60))
        interrupt(process)
        self.assert_clean(self.machine.result(process))


class Threads(MachineTest):
    def test_many_polls_at_once_and_few_threads_to_be_had(self):
        """A process that was stopped finds the polls of all its past runs due."""
        harness.require_root()
        machine = self.machine
        machine.write_export([point("event", "com.vantor.Calendar", "View", "Open")])
        for path, mode in ((machine.root, 0o755), (machine.var_tmp, 0o777)):
            os.chmod(path, mode)
        user = 54321  # who runs nothing else, because the limit counts all threads of a user
        os.chown(machine.state, user, user)
        process = machine.start("/usr/bin/setpriv", f"--reuid={user}", "--clear-groups", "prlimit", "--nproc=24",
                                os.path.join(harness.BIN, "tessel_reporter"),
                                **FaultMachine.faults(HURRY="1"), TESSEL_ACTIVITY_INTERVAL="2", TESSEL_LOG_LEVEL="error")
        self.addCleanup(process.kill)
        wait_for(lambda: process.poll() is not None or runs_of(machine) > 250, 300)
        process.send_signal(signal.SIGSTOP)
        time.sleep(11)  # each poll comes every ten seconds
        process.send_signal(signal.SIGCONT)
        before = runs_of(machine)
        most = 0
        while process.poll() is None and runs_of(machine) < before + 20:
            with contextlib.suppress(FileNotFoundError):
                most = max(most, len(os.listdir(f"/proc/{process.pid}/task")))
        interrupt(process)
        result = machine.result(process)
        self.assertEqual((result.status, result.errors), (0, ""), "it must go on as before")
        self.assertLess(most, 24, "the limit itself must not be what keeps the threads few")


def runs_of(machine):
    """How many runs began, by the last one's hurried clock: each is two seconds after the one before it. The spool knows
    too, but SQLite as root may make a file that the service cannot open for a moment."""
    try:
        with open(os.path.join(machine.state, "scheduler-last-run"), encoding="utf-8") as file:
            return (int(file.read()) / 1e6 - time.time()) / 2
    except FileNotFoundError:
        return 0


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
