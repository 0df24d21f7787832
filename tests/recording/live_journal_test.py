#!/usr/bin/env python3
"""The recording header and the examples against a live journal daemon (see with-journald)."""

import argparse
import json
import os
import subprocess
import unittest

OPTIONS = None
EVENTS = 300


def journalctl(*arguments):
    return subprocess.run(["journalctl", "-D", "/run/log/journal", "--no-pager", *arguments],
                          check=True, capture_output=True, text=True).stdout


def recorded_by(*command, **environment):
    """The entries with a TESSEL field that the command adds, once the daemon has written what it received."""
    cursor = journalctl("-n", "0", "--show-cursor").rsplit("-- cursor: ", 1)[1].strip()
    subprocess.run(command, check=True, stdout=subprocess.DEVNULL, env=dict(os.environ, **environment))
    subprocess.run(["journalctl", "--sync"], check=True)
    lines = journalctl("-o", "json", "--all", "--after-cursor", cursor).splitlines()
    entries = [json.loads(line) for line in lines]
    return [entry for entry in entries if "TESSEL_KIND" in entry or "TESSEL_LOST" in entry]


def lost_by(entries):
    """The losses that the entries tell: of each counter the greatest total."""
    totals = {}
    for entry in entries:
        counter = entry["_PID"], entry.get("TESSEL_LOST_SINCE")
        totals[counter] = max(totals.get(counter, 0), int(entry.get("TESSEL_LOST", 0)))
    return sum(totals.values())


class LiveJournal(unittest.TestCase):
    def test_every_event_arrives_with_what_the_daemon_adds(self):
        entries = recorded_by(OPTIONS.recorder, str(EVENTS))
        events = [entry for entry in entries if entry["TESSEL_KIND"] == "event"]
        self.assertEqual([int(event["TESSEL_NUMBER1_VALUE"]) for event in events], list(range(EVENTS)))
        self.assertEqual({event["_TRANSPORT"] for event in events}, {"journal"})
        self.assertTrue(all("_PID" in event and "_BOOT_ID" in event for event in events))

    def test_what_no_datagram_holds_arrives_whole(self):
        begin, end = [entry for entry in recorded_by(OPTIONS.recorder, "0")]
        for entry in (begin, end):
            fillers = entry["TESSEL_ATTRIBUTE"]
            # The journal keeps equal FIELD=value pairs of one entry once.
            filler = fillers if isinstance(fillers, str) else fillers[0]
            self.assertTrue(filler.startswith("Filler=x\nx"))
            self.assertEqual(len(filler), len("Filler=") + 3999)
        self.assertEqual(begin["TESSEL_INTERVAL_ID"], end["TESSEL_INTERVAL_ID"])
        self.assertEqual(end["TESSEL_FRAME_RATE"], "59.94")

    def test_a_burst_is_in_the_journal_or_lost(self):
        """The program records two more points while it ends."""
        self.assertEqual(len(recorded_by(OPTIONS.burst, "1000")), 1002)
        losses = []
        for count, arguments, environment in ((10_000, (), {}), (10_000, (), {"TESSEL_TRACE_WAIT": "0"}),
                                              (10_000, ("no_wait",), {}), (300, ("no_wait",), {})):
            with self.subTest(arguments, **environment):
                entries = recorded_by(OPTIONS.burst, str(count), *arguments, **environment)
                points = [entry for entry in entries if "TESSEL_KIND" in entry]
                self.assertEqual(len(points) + lost_by(entries), count + 2)
                losses.append(lost_by(entries))
        self.assertGreater(losses[1], 0, "a burst that never waits did not lose anything: it proves nothing")

    def check_example(self, *command, animation=False, **environment):
        entries = recorded_by(*command, **environment)
        kinds = [(entry["TESSEL_KIND"], entry["TESSEL_NAME"]) for entry in entries]
        expected = [("event", "Open"), ("begin", "Load"), ("end", "Load")]
        if animation:
            expected += [("begin", "Scroll"), ("end", "Scroll")]
        self.assertEqual(kinds, expected)
        opened, begin, end = entries[:3]
        self.assertEqual(opened["TESSEL_STRING1_VALUE"], "week")
        self.assertEqual(opened["TESSEL_NUMBER1_VALUE"], "12")
        self.assertEqual({entry["TESSEL_TELEMETRY"] for entry in entries}, {"1"})
        self.assertEqual(begin["TESSEL_INTERVAL_ID"], end["TESSEL_INTERVAL_ID"])
        return entries

    def test_c_and_cpp_examples(self):
        for program in ("example_record_c", "example_record_cpp"):
            with self.subTest(program):
                entries = self.check_example(os.path.join(OPTIONS.examples, program), animation=True)
                self.assertEqual(entries[2]["TESSEL_NUMBER1_VALUE"], str(2**64 - 1))
                self.assertGreater(float(entries[2]["TESSEL_DURATION"]), 0)
                self.assertEqual(entries[4]["TESSEL_FRAME_RATE"], "59.94")

    def test_the_shell_example(self):
        self.check_example(os.path.join(OPTIONS.sources, "record.sh"), PATH=OPTIONS.examples + ":/usr/bin:/bin")


if __name__ == "__main__":
    parser = argparse.ArgumentParser()
    parser.add_argument("--recorder", required=True)
    parser.add_argument("--burst", required=True)
    parser.add_argument("--examples", required=True)
    parser.add_argument("--sources", required=True)
    OPTIONS, rest = parser.parse_known_args()
    unittest.main(argv=[__file__, *rest])
