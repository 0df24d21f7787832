"""A machine on which a preloaded library (fault_shim.c) injects faults, and the checks that follow one."""
import contextlib
import json
import os
import shutil
import sqlite3
import sys
import threading
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))

from harness import BIN, Machine  # noqa: E402

SHIM = os.path.join(BIN, "fault_shim.so")
BAILED = "Bailing due to cookie file"
# The steps of a run: a line that the step logs, and whether the run marker exists at that moment.
STEPS = [("Checking in", False), ("Reporting based on being tasked-on", False), ("Created cookie file", True),
         ("Filesystem for", True), ("Boot disk type", True), ("mach time units per quantum", True),
         ("Sleeping for", True), ("Total tessel object count", True), ("(Count reported to Statora)", True),
         ("String whitelist filtered tessel object count", True), ("Done processing", True), ("Throttled", True),
         ("Cleared cookie file", False)]


def stable(rows):
    """The rows without the duration, which differs from run to run."""
    return [(name, [pair for pair in payload if pair[0] != "ProcessingDurationInSeconds"]) for name, payload in rows]


def is_subsequence(part, whole):
    rest = iter(whole)
    return all(row in rest for row in part)


class NeverInjected(AssertionError):
    """The program ended before its fault could strike, so the test has shown nothing."""


class FaultMachine(Machine):
    def __init__(self, points):
        super().__init__()
        assert os.path.exists(SHIM), f"{SHIM} was not built"  # the loader only warns about a missing library
        self.task()
        self.durable = os.path.join(self.root, "durable")
        self.struck = os.path.join(self.root, "struck")
        self.expected = self.rows_of_a_good_run(points)

    def rows_of_a_good_run(self, points):
        self.write_export(points)
        began = time.monotonic()
        result = self.run()
        self.duration = time.monotonic() - began
        assert result.status == 0, result.errors
        rows = stable(self.rows())
        self.forget_state()
        return rows

    def forget_state(self):
        for folder in (self.state, self.var_tmp, self.durable):
            shutil.rmtree(folder, ignore_errors=True)
            os.mkdir(folder)

    @staticmethod
    def faults(**faults):
        """The environment that makes the faults; keywords are the library's variables without FAULT_."""
        options = "verify_asan_link_order=0:handle_segv=1"
        return {"LD_PRELOAD": SHIM, "ASAN_OPTIONS": options,
                **{"FAULT_" + key: str(value) for key, value in faults.items()}}

    def start_faulty(self, environment=None, **faults):
        """Starts the service with faults; result() then insists that one of them struck."""
        with contextlib.suppress(FileNotFoundError):
            os.unlink(self.struck)
        process = self.start(**self.faults(STRUCK=self.struck, **faults), **(environment or {}))
        process.tessel_faulty = True
        return process

    def run_faulty(self, environment=None, **faults):
        return self.result(self.start_faulty(environment, **faults))

    def run_struck_at(self, at, begin=lambda: None, **faults):
        """A run that is struck at that call. How many rows share a transaction differs from run to run, and so does
        the number of calls: where a run makes fewer, the next one is struck earlier. Calls begin() before each."""
        while True:
            begin()
            try:
                return self.run_faulty(AT=at, **faults)
            except NeverInjected:
                self.forget_state()
                at = max(1, at * 3 // 4)

    def result(self, process, timeout=120):
        result = super().result(process, timeout)
        if getattr(process, "tessel_faulty", False) and not os.path.exists(self.struck):
            raise NeverInjected("the fault was never injected")
        return result

    def count_calls(self, **faults):
        """How many calls of a good run the faults could strike."""
        count = os.path.join(self.root, "count")
        self.run(**self.faults(COUNT=count, **faults))
        self.forget_state()
        with open(count, encoding="ascii") as file:
            return int(file.read())

    def record(self):
        try:
            with open(os.path.join(self.state, "last_run.json"), encoding="utf-8") as file:
                return json.load(file)
        except FileNotFoundError:
            return None

    def ids(self):
        path = os.path.join(self.state, "statora.db")
        if not os.path.exists(path):
            return []
        with contextlib.closing(sqlite3.connect(path)) as database:
            check = database.execute("PRAGMA integrity_check").fetchall()
            assert check == [("ok",)], check
            if not database.execute("SELECT 1 FROM sqlite_master WHERE name = 'events'").fetchall():
                return []
            return [row[0] for row in database.execute("SELECT id FROM events ORDER BY id")]

    def stored(self):
        """The rows of a spool that passes the database's integrity check and has no gap."""
        ids = self.ids()
        rows = stable(self.rows())
        assert ids == list(range(1, len(ids) + 1)), "a row is missing in the middle"
        return rows

    def use_what_a_power_cut_leaves(self):
        """Replaces the spool by its files as they were last flushed before the kill."""
        for suffix in ("", "-wal", "-shm"):
            with contextlib.suppress(FileNotFoundError):
                os.unlink(os.path.join(self.state, "statora.db" + suffix))
        for name in os.listdir(self.durable):
            if name.startswith("statora.db"):
                shutil.copy(os.path.join(self.durable, name), self.state)


class Watcher(threading.Thread):
    """Another client of the spool: counts the rows that it has seen committed."""

    def __init__(self, machine):
        super().__init__()
        self.path, self.seen, self.ended = os.path.join(machine.state, "statora.db"), 0, threading.Event()

    def run(self):
        while not self.ended.wait(0.005):
            with contextlib.suppress(sqlite3.Error):
                if os.path.exists(self.path):
                    with contextlib.closing(sqlite3.connect(f"file:{self.path}?mode=ro", uri=True)) as database:
                        self.seen = database.execute("SELECT count(*) FROM events").fetchone()[0]

    def end(self):
        self.ended.set()
        self.join()
        return self.seen
