#!/usr/bin/env python3
"""Forwarder and receiver are killed at any moment while the service writes: a sample of bench/delivery_trials.py."""
import random
import unittest

import harness
from delivery_kills import BATCH, Trial

KILLS = 25  # of each


class Kills(unittest.TestCase):
    def test_kills_lose_nothing_and_repeat_little(self):
        trial = Trial(at_once=20)
        self.addCleanup(trial.close)

        def look(victim):
            if victim == "forwarder":
                self.assertEqual(trial.query("PRAGMA integrity_check"), [("ok",)])
                ids = trial.query("SELECT id FROM forwarder_delivered UNION ALL SELECT id FROM events ORDER BY 1")
                self.assertEqual(ids, [(number,) for number in range(1, len(ids) + 1)], "each row stands once")

        victims = ["forwarder", "receiver"] * KILLS
        random.shuffle(victims)
        trial.kill(victims, look)
        _, repeated, wrong = trial.outcome()
        self.assertEqual(wrong, [])
        self.assertLessEqual(repeated, len(victims) * BATCH)


if __name__ == "__main__":
    harness.main()
