#!/usr/bin/env python3
"""What `tesselctl rules` says is what the service does."""
import json

import harness
from harness import MachineTest, point

PERFORMANCE = ("com.vantor.PerformanceAnalysis", "PerfLogging", "PerfLoggingOperation")


class Rules(MachineTest):
    def rules(self, *arguments, status=0):
        result = self.machine.ctl("rules", *arguments)
        self.assertEqual(result.status, status, (arguments, result.out, result.errors))
        return result.out

    def records(self, *arguments):
        return [json.loads(line) for line in self.rules(*arguments, "--json").splitlines()]

    def test_each_listed_value_is_reported_and_only_there(self):
        platforms = {one["platform"]: one["values"] for one in self.records() if one["kind"] == "platform"}
        self.assertEqual(len(platforms), 5)
        values = {name: {one["value"] for one in self.records("--platform", name) if one["kind"] == "value"} for name in platforms}
        every = sorted(set.union(*values.values())) + ["weekly", "Week", "week ", "\u202eweek", "tab\tin it"]
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", "Open", string1=("l", value)) for value in every])
        for name, count in platforms.items():
            self.assertEqual(len(values[name]), count)
            lines = self.assert_clean(self.machine.ctl("explain", "--json", "--platform", name)).out.splitlines()
            reported = {value for value, line in zip(every, lines) if json.loads(line)["verdict"] == "reported"}
            self.assertEqual((len(lines), reported), (len(every), values[name]))
        lines = [line.split("\t") for line in self.rules().splitlines()]
        self.assertEqual({line[3] for line in lines if line[0] == "value"}, values["Selvin"])

    def test_a_check_agrees_with_the_service(self):
        cases = [  # platform, internal, path, strings, passes, what the answer names
            ("Selvin", False, ("com.vantor.Calendar", "View", "Open"), [("period", "week")], True, "period-views"),
            ("Selvin", False, ("com.vantor.Calendar", "View", "Open"), [], True, "no downsampling row"),
            ("Selvin", False, ("com.vantor.Calendar", "View", "Open"), [("s", "none"), ("t", "\x1bweek")], False, "string 2"),
            ("Selvin", True, ("com.vantor.Calendar", "View", "Open"), [("period", "weekly")], True, "internal"),
            ("Quarro", False, ("com.vantor.Calendar", "View", "Open"), [("period", "week")], False, "it is a known value on Selvin"),
            ("Selvin", False, ("com.vantor.TextInput", "Keys", "Show"), [], True, "one in 503"),
            ("Selvin", True, ("com.vantor.quellan.knowledge", "tessel", "Footprint"), [], False, "none is reported"),
            ("Quarro", True, PERFORMANCE, [("c", "Application"), ("a", "Open")], True, "actions"),
            ("Quarro", True, PERFORMANCE, [("c", "Application"), ("a", "open")], False, "known values near it: 'Open', "),
            ("Quarro", True, PERFORMANCE, [], False, "string 1, which is absent"),
            ("Lumet", False, ("a", "b", "c"), [("s", "week")], False, "no list of Lumet"),
        ]
        for platform, internal, path, strings, passes, named in cases:
            named_strings = dict(zip(("string1", "string2"), strings))
            self.machine.write_export([point("event", *path, **named_strings, at=-600 + i / 100) for i in range(503)])
            machine = ["--platform", platform, "--internal" if internal else "--no-internal"]
            told = json.loads(self.machine.ctl("explain", "--summary", "--json", *machine).out)
            self.assertEqual(told["verdicts"]["reported"] > 0, passes, path)
            options = [word for slot, (label, value) in named_strings.items() for word in (f"--{slot}", f"{label}={value}")]
            [line] = self.rules("check", *path, *options, *machine, status=0 if passes else 1).splitlines()
            fields = line.split("\t")
            self.assertEqual((fields[0], fields[2], len(fields)), ("passes" if passes else "fails", platform, 4))
            self.assertIn(named, fields[3])
            [answer] = self.records("check", *path, *options, *machine) if passes else [
                json.loads(self.rules("check", *path, *options, *machine, "--json", status=1))]
            self.assertEqual((answer["passes"], answer["verdict"], answer["reason"]), (passes, fields[1], answer["reason"]))

    def test_a_value_and_what_makes_no_sense(self):
        self.assertIn("period-views", self.rules("check", "week"))
        self.assertIn("a known value near it: 'week'", self.rules("check", "Weekly", status=1))
        self.assertIn("''", self.rules("check", "", status=1))
        self.assertIn("\\x1b[31m", self.rules("check", "\x1b[31m", status=1))
        self.machine.set_internal(True)
        self.assertIn("internal", self.rules("check", "weekly"))
        for words in (["check"], ["check", "a", "b"], ["check", "a", "b", "c", "d"], ["check", "a", "", "c"], ["week"],
                      ["check", "week", "--string1", "a=b"], ["check", "a", "b", "c", "--string1", "a"],
                      ["--platform", "Unknown"], ["--markdown", "--json"], ["check", "week", "--markdown"]):
            self.rules(*words, status=2)


if __name__ == "__main__":
    harness.main()
