#!/usr/bin/env python3
"""The spool on a slow disk, beside a reader that stays, after a flood, and when it is full.

TESSEL_SPOOL_OBJECTS and TESSEL_SPOOL_INTERVALS are the numbers of objects on the slow disk, of usual and of the
largest size.
"""
import contextlib
import os
import socket
import sqlite3
import threading
import time

import harness
from faults.fault_machine import FaultMachine
from harness import STATISTICS, MachineTest, point, some_points
from measure import run_measured

OBJECTS = int(os.environ.get("TESSEL_SPOOL_OBJECTS", "160"))
INTERVALS = int(os.environ.get("TESSEL_SPOOL_INTERVALS", "800"))
COMMIT = 40  # milliseconds of a flush of the slow disk
WATCHDOG = 8  # seconds
LEAST_LIMIT = 4 << 20
MEMORY = 64 << 10  # KiB that are not pages of files


class Manager(threading.Thread):
    """The service manager's socket: remembers when a sign of life came."""

    def __init__(self, folder):
        super().__init__()
        self.path, self.signs = os.path.join(folder, "notify"), []
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.socket.bind(self.path)
        self.start()

    def run(self):
        while message := self.socket.recv(4096):
            if b"WATCHDOG=1" in message:
                self.signs.append(time.monotonic())

    def longest_gap(self, ended):
        self.socket.shutdown(socket.SHUT_RD)
        self.join()
        self.socket.close()
        return max(later - earlier for earlier, later in zip(self.signs, self.signs[1:] + [ended]))


def large_intervals(count):
    """Intervals with 128 KB of attributes each, no two alike. The attributes are in no payload."""
    return (large_end(kind, number) for number in range(count) for kind in ("begin", "end"))


def large_end(kind, number):
    attributes = [(f"key{i}", f"{number}.{i}.".ljust(4000, "x")) for i in range(32)] if kind == "begin" else ()
    return point(kind, "com.vantor.Calendar", "View", "Large", interval=str(number), attributes=attributes,
                 at=-900 + number * 0.01 + (0.005 if kind == "end" else 0))


def large_events(count, **extra):
    """Events whose payloads take 120 KB: JSON makes six characters of a control character."""
    text = "\x01" * 4000
    return [point("event", text, text, f"{number}{text}", number1=(text, 1), number2=(text, 2), at=-900 + number * 0.01,
                  **extra) for number in range(count)]


FLOODER = {"uid": 1001, "exe": "/opt/flood"}


def behind(flood):
    """The flood, and then 50 objects of four honest users in the same run."""
    return flood + [point("event", "com.vantor.Calendar", "View", "Honest", at=-600 + i * 0.01, uid=2000 + i % 4,
                          exe="/opt/honest") for i in range(50)]


class SpoolTest(MachineTest):
    def query(self, text):
        with contextlib.closing(sqlite3.connect(os.path.join(self.machine.state, "statora.db"))) as database:
            return database.execute(text).fetchall()

    def names(self):
        return [name for (name,) in self.query("SELECT name FROM events ORDER BY id")]

    def record(self):
        return FaultMachine.record(self.machine)

    def assert_whole(self, objects):
        """The last run stored every row that it should have."""
        record = self.record()
        self.assertEqual(sum(record["rows_failed"].values()), 0, record)
        self.assertEqual(record["classified"][1], objects)
        self.assertEqual(record["rows_stored"], 2 * objects + record["count_events"] + 1)
        self.assertEqual(self.names()[-1], STATISTICS)


class SlowDisk(SpoolTest):
    def time_of_a_run(self, environment):
        before = time.monotonic()
        self.run_clean(**environment)
        return time.monotonic() - before

    def test_it_is_as_fast_as_a_fast_one_and_looks_alive(self):
        self.machine.write_export(some_points(OBJECTS))
        fast = self.time_of_a_run({})
        count = os.path.join(self.machine.root, "flushes")
        faults = FaultMachine.faults(SLOW=COMMIT, PATH="statora.db", CALL="fdatasync", COUNT=count)
        manager = Manager(self.machine.root)
        slow = self.time_of_a_run({**faults, "NOTIFY_SOCKET": manager.path,
                                   "WATCHDOG_USEC": str(WATCHDOG * 1_000_000)})
        gap = manager.longest_gap(time.monotonic())
        with open(count, encoding="ascii") as file:
            flushes = int(file.read())
        print(f"{OBJECTS} objects: {fast:.2f} s, with a commit of {COMMIT} ms {slow:.2f} s and {flushes} flushes; "
              f"no sign of life for {gap:.2f} s")
        self.assertLess(gap, WATCHDOG / 2)
        self.assertLess(slow, 1.3 * fast)
        self.assertLessEqual(flushes, slow + 10, "one a second, and those of opening and closing")
        self.assert_whole(OBJECTS)

    def test_the_largest_rows_stay_within_the_memory(self):
        self.machine.write_export(large_intervals(INTERVALS))
        cost = run_measured(self.machine, **FaultMachine.faults(SLOW=COMMIT), TESSEL_LOG_LEVEL="error")
        self.assertEqual(cost.status, 0, cost.stderr)
        print(f"{INTERVALS} intervals of 128 KB: {cost.anonymous} KiB, {cost.seconds:.1f} s")
        if not harness.SANITIZED:
            self.assertLessEqual(cost.anonymous, MEMORY)
        self.assert_whole(INTERVALS)

    def test_one_that_does_not_keep_up_costs_rows(self):
        self.machine.write_export(large_events(280))
        cost = run_measured(self.machine, **FaultMachine.faults(SLOW=1000), TESSEL_LOG_LEVEL="error",
                            TESSEL_SPOOL_LIMIT=str(2 << 30))
        self.assertEqual(cost.status, 0, cost.stderr)
        record = self.record()
        refused = record["rows_failed"]["buffer_full"]
        self.assertGreater(refused, 0, record)
        print(f"280 events of 120 KB, with a commit of 1 s: {cost.anonymous} KiB, {cost.seconds:.1f} s, {refused} refused")
        if not harness.SANITIZED:
            self.assertLessEqual(cost.anonymous, MEMORY)
        self.assertEqual(record["rows_stored"] + refused, 2 * 280 + record["count_events"] + 1)
        self.assertEqual(self.names()[-1], STATISTICS)
        self.assertEqual(len(self.names()), record["rows_stored"])


class Reader(SpoolTest):
    def test_one_that_sits_there_costs_nothing(self):
        self.machine.write_export(some_points(1))
        self.run_clean()
        self.machine.write_export(some_points(OBJECTS))
        with contextlib.closing(sqlite3.connect(os.path.join(self.machine.state, "statora.db"))) as database:
            database.execute("BEGIN")
            before = database.execute("SELECT count(*) FROM events").fetchone()
            self.run_clean(TESSEL_SPOOL_LIMIT=str(LEAST_LIMIT))
            self.assertEqual(database.execute("SELECT count(*) FROM events").fetchone(), before, "it still sits")
        self.assert_whole(OBJECTS)


class FullSpool(SpoolTest):
    def run_small(self, **extra):
        return self.run_clean(TESSEL_SPOOL_LIMIT=str(LEAST_LIMIT), **extra)

    def assert_honest(self):
        """All 50 objects behind a flood were reported and stored, and only the extraction refused objects."""
        record = self.record()
        self.assertEqual({name: count for name, count in record["rows_failed"].items() if count}, {}, record)
        self.assertEqual(self.names().count("ts__com.vantor.Calendar__View__Honest"), 50)
        self.assertEqual(self.names()[-1], STATISTICS, "there is room for the summary")

    def test_a_flood_leaves_room_for_others(self):
        """Rows of a little more than half a page take a page each; one of the largest objects takes 240 KB at once."""
        half = [point("event", "com.vantor.Calendar", "View", f"Half{i}", number1=("x" * 1800, 1), at=-900 + i * 0.01,
                      **FLOODER) for i in range(100)]
        for flood in (half, half[:24] + large_events(20, **FLOODER)):
            self.machine.write_export(behind(flood))
            self.run_small()
            self.assert_honest()
            self.assertLess(self.record()["inspected"], 90, "the flood was cut")
            for name in os.listdir(self.machine.state):
                os.unlink(os.path.join(self.machine.state, name))

    def test_fourteen_floods_do_not_silence_the_next_run(self):
        limit = {"TESSEL_SPOOL_LIMIT": str(32 << 20)}
        self.machine.write_export(large_events(12, **FLOODER))
        for _ in range(14):
            self.run_clean(**limit)
            self.assertGreater(self.record()["rows_stored"], 2, "each gets some")
        self.machine.write_export(behind(large_events(12, **FLOODER)))
        self.run_clean(**limit)
        self.assert_honest()

    def test_a_full_one_gets_room_as_days_pass(self):
        self.machine.write_export(some_points(50))
        self.run_small()
        day = 86_400_000_000
        with contextlib.closing(sqlite3.connect(os.path.join(self.machine.state, "statora.db"))) as database:
            old = (int(time.time() * 1e6) - 29 * day, "old", "{}".ljust(9000))
            # The objects of a run may not use the last sixteenth, and half of that is the summary's.
            while database.execute("PRAGMA page_count").fetchone()[0] * 4096 < LEAST_LIMIT * 0.915:
                database.execute("INSERT INTO events(time, name, payload) VALUES(?, ?, ?)", old)
            database.commit()
            rows = database.execute("SELECT count(*) FROM events WHERE name = 'old'").fetchone()[0]
        full = os.path.getsize(os.path.join(self.machine.state, "statora.db"))
        self.run_small()
        record = self.record()
        self.assertEqual(record["rows_failed"]["limit"], 100, record)
        self.assertEqual((record["rows_stored"], record["rows_expired"]), (record["count_events"] + 1, 0))
        self.assertEqual(self.names()[-1], STATISTICS, "its row is the last to be refused")
        with contextlib.closing(sqlite3.connect(os.path.join(self.machine.state, "statora.db"))) as database:
            database.execute(f"UPDATE events SET time = time - {2 * day} WHERE name = 'old'")
            database.commit()
        said = f"Rows of the spool expired: {rows} stood there for longer than TESSEL_SPOOL_DAYS"
        self.assertIn(said, self.run_small().warnings)
        self.assertEqual(self.record()["rows_expired"], rows)
        self.assertEqual(self.record()["totals"], {"expired": rows, "failed": {"limit": 200}})
        self.assertLess(os.path.getsize(os.path.join(self.machine.state, "statora.db")), full / 10)
        self.run_small()
        self.assert_whole(50)


if __name__ == "__main__":
    harness.main()
