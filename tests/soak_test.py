#!/usr/bin/env python3
"""Many runs in one process whose clocks are hurried on: its memory, threads and descriptors do not grow.

TESSEL_SOAK_RUNS is the number of runs. The sanitizer builds leave this test out: a sanitizer keeps the
memory that the program frees.
"""
import contextlib
import os
import sqlite3
import time

import harness
from harness import BIN, MachineTest, point
from measure import anonymous_memory

RUNS = int(os.environ.get("TESSEL_SOAK_RUNS", "200"))
# The poll of a past run goes on, and takes this much at most.
BYTES_PER_RUN = 1024
# Heaps with holes, and the stacks that the C library keeps for the next threads.
SLACK = 1 << 20


class Soak(MachineTest):
    def figures(self, process, runs):
        """Once so many runs are done: memory that is not pages of files in bytes, threads, descriptors."""
        deadline = time.monotonic() + 60 + runs
        while self.runs_done() < runs:
            self.assertIsNone(process.poll(), "it must stay")
            self.assertLess(time.monotonic(), deadline, f"{self.runs_done()} runs")
            time.sleep(0.05)
        # The least of many looks is that of a moment between two runs.
        least = tuple(map(min, zip(*self.looks(process.pid))))
        print(f"after {runs} runs: {least[0]} bytes, {least[1]} threads, {least[2]} descriptors", flush=True)
        return least

    @staticmethod
    def looks(pid):
        for _ in range(200):
            time.sleep(0.01)
            yield (anonymous_memory(pid) * 1024, *(len(os.listdir(f"/proc/{pid}/{kind}")) for kind in ("task", "fd")))

    def runs_done(self):
        try:
            uri = f"file:{self.machine.state}/statora.db?mode=ro"
            with contextlib.closing(sqlite3.connect(uri, uri=True)) as database:
                return database.execute("SELECT ifnull(max(id), 0) FROM events").fetchone()[0] // 8
        except sqlite3.OperationalError:
            return 0  # not made yet, or just being written

    def test_many_runs_leave_little_behind(self):
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", f"Open{i}") for i in range(2)])
        process = self.machine.start(TESSEL_ACTIVITY_INTERVAL="2", TESSEL_LOG_LEVEL="error", FAULT_HURRY="1",
                                     LD_PRELOAD=os.path.join(BIN, "fault_shim.so"))
        self.addCleanup(process.kill)
        at = [RUNS // 10, RUNS // 4, RUNS // 2, RUNS]
        seen = [self.figures(process, runs) for runs in at]
        process.kill()
        self.assertEqual(self.machine.result(process).errors, "")
        growth = (seen[-1][0] - seen[-2][0]) / (at[-1] - at[-2])
        print(f"{growth:.0f} bytes a run")
        self.assertLess(seen[-1][0] - seen[-2][0], BYTES_PER_RUN * (at[-1] - at[-2]) + SLACK)
        self.assertLessEqual(seen[-1][1], seen[0][1] + 2)
        self.assertLessEqual(seen[-1][2], seen[0][2] + 2)


if __name__ == "__main__":
    harness.main()
