#!/usr/bin/env python3
"""What leaves the machine, and what can be set, is what docs/ and the manuals say: keys, settings, options."""
import copy
import glob
import json
import os
import re
import subprocess
import unittest

from jsonschema import Draft202012Validator  # of the package python3-jsonschema

import harness
from harness import BIN, MachineTest
from mixed_day import mixed_day

ROOT = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..")
DOCS = os.path.join(ROOT, "docs")

with open(os.path.join(DOCS, "events.schema.json"), encoding="utf-8") as file:
    SCHEMA = json.load(file)
VALIDATOR = Draft202012Validator(SCHEMA)


def text_of(*paths):
    """The files below the root, one behind the other. A path may have * and ** in it."""
    found = [file for path in paths for file in sorted(glob.glob(os.path.join(ROOT, path), recursive=True))]
    assert len(found) >= len(paths), paths
    texts = []
    for path in found:
        with open(path, encoding="utf-8") as file:
            texts.append(file.read())
    return "\n".join(texts)


def first_column(page, heading):
    """What stands in backquotes in the first column of the tables below a heading."""
    section = text_of(page).split(f"\n## {heading}\n")[1].split("\n## ")[0]
    return {name for row in re.findall(r"(?m)^\| ([^|]*`[^|]*) \|", section) for name in re.findall(r"`([^`]+)`", row)}


def of_manual(name, tag):
    """The names that a manual explains: variables (Ev) or options (Fl)."""
    rows = re.findall(rf"(?m)^\.It ({tag} .*)", text_of("packaging/man/" + name))
    pattern = r"[A-Z][A-Z0-9_]+" if tag == "Ev" else r"\\-[a-z0-9\\-]+"
    return {word.replace("\\-", "-") for row in rows for word in re.findall(pattern, row)}


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


class Forwarded(MachineTest):
    def test_each_key_of_the_forwarder_is_on_the_pages(self):
        self.machine.write_export(mixed_day(self.machine)[0])
        self.run_clean()
        with open(self.machine.os_release, "w", encoding="utf-8") as file:
            file.write('NAME="Debian"\nVERSION_ID="12"\n')
        payload_keys = {key for _, pairs in self.machine.rows() for key, _ in pairs}
        out = self.machine.result(self.machine.start("statora_forwarder", "--dry-run=raw", TESSEL_FORWARD_INSTANCE_ID="1",
                                                     OTEL_EXPORTER_OTLP_PROTOCOL="http/json")).out
        added = set()
        for body in map(json.loads, out.splitlines()):
            [logs] = body["resourceLogs"]
            added |= {one["key"] for one in logs["resource"]["attributes"]}
            for record in logs["scopeLogs"][0]["logRecords"]:
                added |= set(record) | {one["key"] for one in record["attributes"]} - payload_keys
        self.assertEqual(first_column("docs/privacy.md", "What the forwarder adds"), added - {"attributes"})
        self.assertEqual(set(re.findall(r"`([A-Za-z.]+)`", text_of("docs/fleet.md"))) & added, added)


class WhatCanBeSet(unittest.TestCase):
    LAUNCH = dict(re.findall(r'"(TESSEL_\w+)", configuration\.(\w+)', text_of("src/linux/LaunchConfiguration.cpp")))
    SETTINGS = text_of("src/forwarder/Settings.cpp")
    FORWARDER = set(re.findall(r'"(TESSEL_FORWARD_\w+|OTEL_RESOURCE_\w+)"', SETTINGS)) | {
        "OTEL_EXPORTER_OTLP_" + name for name in re.findall(r'(?:standard|path)\("(\w+)"\)', SETTINGS)}

    def used_in(self, *paths):
        used = set(re.findall(r"(?:launch|configuration)\.(\w+)", text_of(*paths)))
        return {variable for variable, member in self.LAUNCH.items() if member in used}

    def test_each_variable_is_on_its_page_and_manual(self):
        self.assertGreater(min(len(self.LAUNCH), len(self.FORWARDER)), 12)
        self.assertEqual(first_column("docs/operating.md", "Settings"), set(self.LAUNCH))
        self.assertEqual(of_manual("tessel_reporter.8", "Ev"), set(self.LAUNCH))
        self.assertEqual(first_column("docs/fleet.md", "Settings"), self.FORWARDER)
        self.assertEqual(of_manual("statora_forwarder.8", "Ev"),
                         self.FORWARDER | {"CREDENTIALS_DIRECTORY"} | self.used_in("src/forwarder/main.cpp"))
        recording = set(re.findall(r'getenv\("(TESSEL_\w+)"\)', text_of("include/tessel/*.h")))
        self.assertEqual(of_manual("tessel-trace-points.7", "Ev"), recording)
        self.assertEqual(recording - set(re.findall(r"TESSEL_\w+", text_of("docs/recording.md"))), set())
        used = self.used_in("src/tesselctl/**/*.cpp") | recording
        self.assertEqual({name for name in of_manual("tesselctl.1", "Ev") if name.startswith("TESSEL_")}, used)

    def options(self, program, *words):
        help_text = subprocess.run([os.path.join(BIN, program), *words, "--help"], capture_output=True, text=True, check=True).stdout
        names = re.search(r"(?m)^Subcommands:\n((?:  .*\n)+)", help_text)
        below = [self.options(program, *words, name) for name in re.findall(r"(?m)^  (\w+)", names[1] if names else "")]
        return set(re.findall(r"(?m)^  (?:-\w,)?(--[a-z][a-z0-9-]*)", help_text)).union(*below)

    def test_each_option_is_in_its_manual_and_no_other(self):
        known = self.options("tesselctl")
        self.assertGreater(len(known), 40)
        result = subprocess.run([os.path.join(ROOT, "scripts/update-docs"), "--check", BIN], capture_output=True, text=True, check=False)
        self.assertEqual((result.returncode, result.stdout), (0, ""), result.stderr)
        self.assertEqual({"-" + name for name in of_manual("tesselctl.1", "Fl") }, known)
        forwarder = self.options("statora_forwarder")
        self.assertEqual({"-" + name for name in of_manual("statora_forwarder.8", "Fl")} | {"--help", "--version"}, forwarder)
        others = {"--cursor", "--now"}  # of journalctl and systemctl
        told = set(re.findall(r"(?<![\w-])--[a-z][a-z0-9-]*", text_of("docs/tesselctl.md", "docs/privacy.md", "docs/fleet.md")))
        self.assertEqual(told - known - forwarder - others, set())


if __name__ == "__main__":
    harness.main()
