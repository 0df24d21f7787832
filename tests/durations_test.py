#!/usr/bin/env python3
"""Durations and frame rates in `tesselctl explain` and `tesselctl compare`, against the sorted values of model.py."""
import json
import math
import random

import harness
from harness import point
from mixed_day import mixed_day
from model import deliver, shortest
from output_test import OutputTest

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


class DurationsTest(OutputTest):
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
        self.assertTrue("\n40\t0.5\t0.5\t0.5\t0.5\tcom.vantor.Render / Frame / Draw\n" in text)
        self.assertIn(f'{summary["durations_not_listed"]:,} values of further trace points', text.replace("\u202f", ","))


class Objects(DurationsTest):
    def test_each_object_shows_how_long_and_by_whom(self):
        entries = mixed_day(self.machine)[0] + [
            point("event", "com.vantor.Mail", "Fetch", "Nobody", exe=None, comm=None, pid=None),
            point("event", "com.vantor.Mail", "Fetch", "User", uid=1000, pid=2_000_000)]
        self.machine.write_export(entries)
        shown, things = self.json("explain"), deliver(entries)
        fields = [line.split("\t") for line in self.machine.ctl("explain").out.splitlines()]
        self.assertEqual(len(shown), len(things))
        handed_over = 0
        for line, thing, field in zip(shown, things, fields):
            stated = thing.kind != "Event" or thing.get("DURATION") is not None
            rate = float(thing.get("FRAME_RATE")) if thing.kind == "AnimationInterval" else None
            self.assertEqual((line.get("duration"), line.get("frame_rate")), (shortest(thing.duration) if stated else None, rate))
            process = {key: value for key, value in (("name", thing.end.comm), ("image", thing.end.exe), ("pid", thing.end.pid),
                                                     ("uid", thing.end.uid)) if value is not None}
            self.assertEqual(line["process"], process)
            begin = {"name": thing.begin.comm, "image": thing.begin.exe}
            moved = begin != {"name": thing.end.comm, "image": thing.end.exe}
            self.assertEqual(line.get("begin_process"), begin if moved else None)
            handed_over += moved
            self.assertEqual([float(text) if text else None for text in field[7:9]], [line.get("duration"), line.get("frame_rate")])
            self.assertEqual(field[9:], [str(process.get(key, "")) for key in ("name", "pid", "uid")])
        self.assertGreater(handed_over, 0)


class Compare(DurationsTest):
    LAST_WEEK = ("compare", "since=-14d,until=-7d", "last=7d")

    def record_two_weeks(self, weeks):
        """`weeks`: name to the durations of the week before last and of the last one."""
        self.machine.write_export(sorted((entry for name, sides in weeks.items() for side, durations in enumerate(sides)
                                          for entry in intervals(name, durations, -86_400 * (10, 3)[side])),
                                         key=lambda entry: entry.at))

    def test_what_became_slower_comes_first(self):
        draw = random.Random(7)
        some = lambda count, median, spread=0.5: [draw.lognormvariate(math.log(median), spread) for _ in range(count)]
        weeks = {"Slower": (some(500, 0.05), some(400, 0.12)), "Tail": ([0.01] * 400, [0.01] * 360 + [0.9] * 40),
                 "Worst": (some(40, 0.001), some(40, 1)), "Three": (some(3, 0.001), [30.0] * 3), "Same": (some(500, 0.05),) * 2,
                 "Faster": (some(300, 0.5), some(300, 0.05)), "Gone": (some(20, 0.1), []), "New": ([], some(20, 0.1))}
        self.record_two_weeks(weeks)
        compared = self.json(*self.LAST_WEEK)[0]
        self.assertEqual([(row["change"], row["name"]) for row in compared["durations"]],
                         [("slower", "Worst"), ("slower", "Tail"), ("slower", "Slower"), ("same", "Same"), ("faster", "Faster"),
                          ("few_values", "Three"), ("only_a", "Gone"), ("only_b", "New")])
        for row in compared["durations"]:
            for side, values in zip("ab", weeks[row["name"]]):
                self.assertEqual(row[side]["count"], len(values))
                for key in ("p50", "p95", "p99") if values else ():
                    self.assert_near(row[side][key], quantile([round(value, 6) for value in values], int(key[1:]) / 100))
        worst, tail, _, same, faster = compared["durations"][:5]
        self.assertAlmostEqual(worst["factor"], worst["b"]["p50"] / worst["a"]["p50"], 3)
        self.assertAlmostEqual(tail["factor"], tail["b"]["p95"] / tail["a"]["p95"], 3)
        self.assertLess(faster["factor"], 0.2)
        self.assertAlmostEqual(same["factor"], 1)
        # A frame rate is slower where it is lower: `Worst` went from 60 to 59, `Tail` at its 5th percentile as well.
        rates = {row["name"]: row for row in compared["frame_rates"]}
        self.assertGreater(rates["Worst"]["factor"], 1)
        self.assertLess(rates["Worst"]["b"]["p50"], rates["Worst"]["a"]["p50"])
        text = self.machine.ctl(*self.LAST_WEEK).out
        self.assertIn("3 slower, 1 same, 1 faster, 1 few values, 1 only in A, 1 only in B", text)

    def test_a_terminal_shows_both_periods_in_80_columns(self):
        self.record_two_weeks({"Long" * 20: ([0.0125] * 20, [0.05] * 30), "Three": ([0.001] * 3, [30.0] * 3), "New": ([], [1.0] * 20)})
        _, out = self.on_terminal(*self.LAST_WEEK, TERM="dumb")
        self.assertLessEqual(max(map(len, out.splitlines())), 80)
        self.assertRegex(out, r"\n  4\.00x slower +com\.vantor\.Render / [^,]*Long\n +p50 12\.5 ms -> 50\.0 ms, p95 12\.5 ms -> 50\.0 ms, 20 -> 30 values\n")
        self.assertRegex(out, r"\n  few values +com\.vantor\.Render / Frame / Three\n +p50 1\.00 ms -> 30\.0 s,")
        self.assertRegex(out, r"\n  only in B +com\.vantor\.Render / Frame / New\n +p50 1\.00 s, p95 1\.00 s, 20 values\n")
        _, out = self.on_terminal("explain", "--since", "-4d", "--name", "New", TERM="dumb")
        self.assertIn("(1.00 s, 59.0 fps, Clock[4711])", " ".join(out.split()))

    def test_slower_frames_are_lower_rates(self):
        frames = lambda name, rates, at: [entry for i, rate in enumerate(rates) for entry in (
            point("begin", "com.vantor.Render", "Frame", name, interval=f"{i}", at=at + i, mono=10**9 + i * 10**6),
            point("end", "com.vantor.Render", "Frame", name, interval=f"{i}", at=at + i, mono=10**9 + i * 10**6 + 500, frame_rate=rate))]
        self.machine.write_export(frames("Scroll", [60] * 200, -864_000) + frames("Spin", [60] * 200, -863_000)
                                  + frames("Scroll", [30] * 200, -86_400) + frames("Spin", [60] * 180 + [0] * 20, -85_000))
        rows = self.json(*self.LAST_WEEK)[0]["frame_rates"]
        self.assertEqual([(row["change"], row["name"]) for row in rows], [("slower", "Spin"), ("slower", "Scroll")])
        self.assertEqual((rows[1]["factor"], rows[1]["a"]["p50"], rows[1]["b"]["p50"]), (2, 60, 30))

    def test_chance_makes_nothing_slower(self):
        draw = random.Random(3)
        self.record_two_weeks({f"N{i}": [[draw.lognormvariate(-3, 1.5) for _ in range(draw.choice((5, 20, 200)))] for _ in "ab"]
                               for i in range(120)})
        compared = self.json(*self.LAST_WEEK)[0]
        self.assertEqual({row["change"] for row in compared["durations"]}, {"same", "few_values"})

    def test_a_flood_makes_nothing_seem_gone(self):
        flood = [point("event", f"com.vantor.F{i % 40}", "A", f"N{i}", duration="1", at=-500_000 + i) for i in range(20_000)]
        self.machine.write_export(intervals("Draw", [0.5] * 40, -900_000) + flood + intervals("Draw", [0.5] * 40, -3000))
        compared = self.json(*self.LAST_WEEK)[0]
        [row] = [row for row in compared["durations"] if row["change"] != "only_b"]
        self.assertEqual((row["name"], row["change"], row["a"]["count"], row["b"]["count"]), ("Draw", "same", 40, 40))
        listed = sum(row["b"]["count"] for row in compared["durations"])
        self.assertEqual((listed + compared["durations_not_listed"]["b"], compared["durations_not_listed"]["a"]), (20_040, 0))

    def test_a_store_younger_than_the_period_is_said_to_be(self):
        self.machine.write_export(intervals("Draw", [0.5] * 40, -3000))
        compared = self.json(*self.LAST_WEEK)[0]
        self.assertEqual([compared["periods"][side]["reaches_start"] for side in "ab"], [False, False])
        self.assertAlmostEqual(compared["periods"]["b"]["end"] - compared["periods"]["a"]["start"], 14 * 86_400e6, delta=1e6)
        self.assertRegex(self.machine.ctl(*self.LAST_WEEK).out, "\nA: The store reaches back to .* only.\n")
        # Over one period both sides have the same durations, so there is nothing to compare.
        self.assertNotIn("durations", self.json("compare", "usual", "internal")[0])


if __name__ == "__main__":
    harness.main()
