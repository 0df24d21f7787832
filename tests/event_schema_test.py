#!/usr/bin/env python3
"""Every row that a run spools is as docs/events.schema.json and docs/events.md say."""
import copy
import json
import os
import re
import unittest

from jsonschema import Draft202012Validator  # of the package python3-jsonschema

import harness
from harness import MachineTest
from mixed_day import mixed_day

DOCS = os.path.join(os.path.dirname(os.path.abspath(__file__)), "../docs")

with open(os.path.join(DOCS, "events.schema.json"), encoding="utf-8") as file:
    SCHEMA = json.load(file)
VALIDATOR = Draft202012Validator(SCHEMA)


def properties_of(name):
    kind = {"com.vantor.performance.tessel_counts": "count",
            "com.vantor.performance.tessel_reporting_stats": "statistics"}.get(name, "object")
    return list(SCHEMA["$defs"][kind]["properties"])


class SpooledRows(MachineTest):
    def spooled(self, internal):
        entries, _ = mixed_day(self.machine)
        self.machine.write_export(entries)
        self.machine.set_internal(internal)
        self.machine.run()
        return self.machine.rows()

    def check(self, rows):
        self.assertGreater(len(rows), 20)
        for name, pairs in rows:
            VALIDATOR.validate({"name": name, "payload": dict(pairs)})
            keys = [key for key, _ in pairs]
            self.assertEqual(keys, [key for key in properties_of(name) if key in keys])
            if name.startswith("ts__"):
                payload = dict(pairs)
                self.assertEqual(name, "ts__{Subsystem}__{Category}__{Name}".format(**payload))

    def test_as_shipped(self):
        rows = self.spooled(internal=False)
        self.check(rows)
        kinds = {dict(pairs).get("IntervalType") for _, pairs in rows}
        self.assertEqual(kinds, {"Event", "Interval", "AnimationInterval", None})

    def test_with_internal_diagnostics(self):
        self.check(self.spooled(internal=True))


class TheSchemaItself(unittest.TestCase):
    EVENT = {"name": "com.vantor.performance.tessel",
             "payload": {"Subsystem": "com.vantor.Calendar", "Category": "View", "Name": "Open", "IntervalType": "Event",
                         "DurationInSeconds": 0, "StartProcessName": "Unknown", "BootDiskType": "SSD"}}

    def test_says_no(self):
        spoiled = [
            lambda event: event.update(name="com.vantor.performance.other"),
            lambda event: event["payload"].pop("Subsystem"),
            lambda event: event["payload"].update(DurationInSeconds=-1),
            lambda event: event["payload"].update(DurationInSeconds="1"),
            lambda event: event["payload"].update(IntervalType="TesselObject"),
            lambda event: event["payload"].update(EndProcessName="Clock"),
            lambda event: event["payload"].update(String1Value="week"),
            lambda event: event["payload"].update(User="someone"),
        ]
        VALIDATOR.validate(self.EVENT)
        for spoil in spoiled:
            event = copy.deepcopy(self.EVENT)
            spoil(event)
            self.assertFalse(VALIDATOR.is_valid(event), event)

    def test_the_page_explains_every_key(self):
        with open(os.path.join(DOCS, "events.md"), encoding="utf-8") as page:
            explained = set(re.findall(r"(?m)^\| `([A-Za-z0-9]+)` \|", page.read()))
        kinds = ("object", "count", "statistics")
        self.assertEqual(explained, {key for kind in kinds for key in SCHEMA["$defs"][kind]["properties"]})


if __name__ == "__main__":
    harness.main()
