#!/usr/bin/env python3
"""Durations and frame rates in `tesselctl explain` and `tesselctl compare`, against the sorted values of model.py."""
import json
import math
import random

import harness
from harness import MachineTest, point
from mixed_day import mixed_day
from model import deliver

ERROR = 1 / 65  # of a quantile, relative
NANOSECOND = 2**-30
TWO_YEARS = 2**26


def quantile(values, part):
    return sorted(values)[max(math.ceil(part * len(values)), 1) - 1]


def intervals(name, durations, at, pid=4711):
    """An animation interval for each duration, a tenth of a second apart."""
    return [entry for i, duration in enumerate(durations) for entry in (
        point("begin", "com.vantor.Render", "Frame", name, interval=f"{name}{i}", at=at + i / 10, mono=10**9 + i * 10**7, pid=pid),
        point("end", "com.vantor.Render", "Frame", name, interval=f"{name}{i}", at=at + i / 10 + 0.01,
              mono=10**9 + i * 10**7 + round(duration * 1e6), frame_rate=f"{60 - duration:.3f}", pid=pid))]


class DurationsTest(MachineTest):
    def json(self, *arguments):
        result = self.machine.ctl(*arguments, "--json")
        self.assertEqual((result.status, result.errors), (0, ""))
        return [json.loads(line) for line in result.out.splitlines()]

    def assert_near(self, estimate, exact):
        if exact >= TWO_YEARS:
            self.assertGreaterEqual(estimate, TWO_YEARS)
        else:
            self.assertLessEqual(abs(estimate - exact), max(abs(exact) * ERROR * 1.0001, NANOSECOND))


class Explain(DurationsTest):
    def test_quantiles_are_those_of_the_recorded_points(self):
        draw = random.Random(18)
        entries = mixed_day(self.machine)[0] + intervals("Scroll", [draw.lognormvariate(-3, 1) for _ in range(500)], -3000)
        entries += [point("event", "com.vantor.Mail", "Fetch", "Stated", duration=f"{10 ** draw.uniform(-12, 12):.3e}",
                          at=-200 + i / 10) for i in range(300)]
        entries += [point("event", "com.vantor.Mail", "Fetch", "Stated", duration="-0.5"),
                    point("event", "com.vantor.Mail", "Fetch", "Stated", duration="0")]
        self.machine.write_export(entries)
        summary = self.json("explain", "--summary")[0]
        expected = {"durations": {}, "frame_rates": {}}
        for thing in deliver(entries):
            path = tuple(text or "" for text in thing.path)
            if thing.kind != "Event" or thing.get("DURATION") is not None:
                expected["durations"].setdefault(path, []).append(thing.duration)
            if thing.kind == "AnimationInterval":
                expected["frame_rates"].setdefault(path, []).append(float(thing.get("FRAME_RATE")))
        for measure, points in expected.items():
            rows = {(row["subsystem"], row["category"], row["name"]): row for row in summary[measure]}
            self.assertEqual(set(rows), set(points))
            for path, values in points.items():
                row, good = rows[path], [value for value in values if value >= 0]
                self.assertEqual((row["count"], row["negative"]), (len(good), len(values) - len(good)), path)
                for key in row.keys() & {"p1", "p5", "p50", "p95", "p99"}:
                    if good:
                        self.assert_near(row[key], quantile(good, int(key[1:]) / 100))
                    else:
                        self.assertIsNone(row[key])
                if good:
                    self.assertAlmostEqual(row["max"] / (max(good) or 1), bool(max(good)), 6)
            self.assertEqual(summary[measure + "_not_listed"], 0)
        self.assertGreater(len(expected["durations"]), len(expected["frame_rates"]))

    def test_a_flood_of_names_hides_no_other(self):
        values = ["-1", "0", "1e30", "3.4e38", "1e-40", "0.5"]
        flood = [point("event", "com.vantor.Flood", "A", f"N{i}", duration=values[i % 6], at=-3600 + i / 100)
                 for i in range(29_000)]
        self.machine.write_export(flood + intervals("Draw", [0.5] * 40, -3000))
        summary = self.json("explain", "--summary")[0]
        self.assertEqual(summary["durations"][0]["name"], "Draw")
        self.assertEqual(summary["durations"][0]["p50"], 0.5)
        listed = sum(row["count"] + row["negative"] for row in summary["durations"])
        self.assertLess(listed, 1000)
        self.assertEqual(listed + summary["durations_not_listed"], 29_040)
        text = self.machine.ctl("explain", "--summary").out
        self.assertRegex(text, r"\n40\t0\.5\d*\t0\.5\d*\t0\.5\d*\t0\.5\tcom\.vantor\..*Draw\n")
        self.assertIn(f'{summary["durations_not_listed"]:,} values of further trace points', text.replace("\u202f", ","))


if __name__ == "__main__":
    harness.main()
