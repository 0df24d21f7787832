#!/usr/bin/env python3
"""What `tesselctl explain` says, compared with a run's own counts and with the rules in model.py."""
import json
import os
import subprocess
import time

import harness
from harness import Entry, MachineTest, export_bytes, log_event, point
from mixed_day import mixed_day
from model import DISABLED, DOWNSAMPLED, DURATION, KNOWN, REPORTED, WHITELIST, Rules, deliver

VERDICT = {REPORTED: ("reported", 1), DISABLED: ("telemetry_disabled", 0), WHITELIST: ("string_whitelist", 2),
           DURATION: ("duration", 3), DOWNSAMPLED: ("downsampled", 4)}
HEADERS = {"Reported tessel object": "reported", "Subsystem/category filtered tessel object": "downsampled",
           "Duration filtered tessel object": "duration", "String whitelist filtered tessel object": "string_whitelist"}


def lines_of(result):
    return [json.loads(line) for line in result.out.splitlines()]


class ExplainTest(MachineTest):
    def explain(self, *arguments, **extra):
        result = self.machine.ctl("explain", "--json", *arguments, **extra)
        self.assertEqual((result.status, result.errors), (0, ""))
        return lines_of(result)

    def summary(self, *arguments, **extra):
        return self.explain("--summary", *arguments, **extra)[0]


class MixedDay(ExplainTest):
    def setUp(self):
        super().setUp()
        self.entries, _ = mixed_day(self.machine)
        self.machine.write_export(self.entries)

    def assert_verdicts(self, explained, rules):
        judged = [(thing, rules.classify(thing)) for thing in deliver(self.entries)]
        self.assertGreater(len({verdict for _, verdict in judged}), 3)
        self.assertEqual(
            [(line["subsystem"], line["category"], line.get("name"), line["kind"], line["verdict"],
              line["classification"], line["time"]) for line in explained],
            [(*thing.path, thing.kind, *VERDICT[verdict], thing.end.realtime(self.machine.now))
             for thing, verdict in judged])
        return judged

    def test_every_object_gets_the_verdict_of_the_rules(self):
        self.assert_verdicts(self.explain(), Rules())
        self.assert_verdicts(self.explain("--internal"), Rules(internal=True))

    def test_the_rule_says_what_decided(self):
        judged = self.assert_verdicts(self.explain(), Rules())
        for line, (thing, verdict) in zip(self.explain(), judged):
            rule = line.get("rule")
            if verdict == WHITELIST:
                slot = "STRING1" if thing.get("STRING1_NAME") and thing.get("STRING1_VALUE") not in KNOWN else "STRING2"
                self.assertEqual((rule["slot"], rule["label"], rule.get("value")),
                                 (int(slot[-1]), thing.get(slot + "_NAME"), thing.get(slot + "_VALUE")))
            elif verdict == DURATION:
                self.assertLess(rule["duration"], 0)
            elif verdict == DISABLED:
                self.assertIsNone(rule)

    def test_downsampling_counters_are_the_current_ones(self):
        keys = [line for line in self.explain("--subsystem", "com.vantor.TextInput")]
        self.assertEqual([line["rule"]["seen"] for line in keys], list(range(1, 505)))
        self.assertEqual([line["rule"]["seen"] for line in keys if line["verdict"] == "reported"], [503])
        self.assertEqual([line["rule"]["reported"] for line in keys[501:]], [0, 1, 1])
        for line in keys:
            self.assertEqual((line["rule"]["scope"], line["rule"]["cap"], line["rule"]["ratio"]),
                             ("com.vantor.TextInput", 500, 503))

    def test_the_payload_is_the_one_that_the_service_sends(self):
        explained = [list(line["payload"].items()) for line in self.explain("--payload") if "payload" in line]
        self.assert_clean(self.machine.run())
        sent = [payload for name, payload in self.machine.rows() if name == "com.vantor.performance.tessel"]
        self.assertGreater(len(sent), 10)
        self.assertEqual(explained, sent)

    def test_the_figures_are_those_of_the_run_pair_by_pair(self):
        summary = self.summary()
        run = self.machine.run()
        self.assert_clean(run)
        sections, header = {}, None
        for message in run.log:
            for line in message.split("\n"):
                if " count: " in line:
                    header = HEADERS.get(line.split(" count: ")[0])
                elif header and ":\t" in line:
                    pair, count = line.split(":\t")
                    sections.setdefault(header, {})[pair] = int(count.split(" ")[0])
        for verdict, counted in sections.items():
            explained = {f"{pair['subsystem']}/{pair['category']}": pair[verdict] for pair in summary["pairs"]
                         if pair[verdict]}
            self.assertEqual(explained, counted, verdict)
        self.assertEqual(set(sections), set(HEADERS.values()))
        statistics = dict(self.machine.rows()[-1][1])
        self.assertEqual(summary["log_events"], statistics["LogObjectsProcessed"])
        for kind, key in (("Event", "Events"), ("Interval", "Intervals"), ("AnimationInterval", "Animations")):
            self.assertEqual(summary["kinds"][kind], {"reported": statistics[key + "Reported"],
                                                      "unreported": statistics[key + "NotReported"]})
        with open(os.path.join(self.machine.state, "last_run.json"), encoding="utf-8") as file:
            classified = json.load(file)["classified"]
        self.assertEqual([summary["verdicts"][name] for name, _ in sorted(VERDICT.values(), key=lambda v: v[1])],
                         classified[:5])

    def test_whitelist_misses_are_listed_with_their_count(self):
        expected = {}
        for line in self.explain("--verdict", "string_whitelist"):
            key = (line["subsystem"], line["category"], line["name"], line["rule"]["slot"], line["rule"].get("value", ""))
            expected[key] = expected.get(key, 0) + 1
        listed = {(miss["subsystem"], miss["category"], miss["name"], miss["slot"], miss["value"]): miss["count"]
                  for miss in self.summary()["whitelist_misses"]}
        self.assertGreater(len(expected), 2)
        self.assertEqual(listed, expected)

    def test_filters_narrow_the_output_not_the_verdicts(self):
        everything = self.explain()
        for arguments, wanted in ((("--subsystem", "com.vantor.M*"), lambda line: line["subsystem"].startswith("com.vantor.M")),
                                  (("--category", "Keys3"), lambda line: line["category"] == "Keys3"),
                                  (("--name", "Draw", "--name", "Lost"), lambda line: line.get("name") in ("Draw", "Lost")),
                                  (("--verdict", "downsampled"), lambda line: line["verdict"] == "downsampled")):
            chosen = [line for line in everything if wanted(line)]
            self.assertTrue(chosen and len(chosen) < len(everything))
            self.assertEqual(self.explain(*arguments), chosen)

    def test_nothing_is_sent_and_nothing_is_left_behind(self):
        self.explain("--payload")
        self.assertEqual(os.listdir(self.machine.state), [])
        self.assertFalse(self.machine.marker_exists())

    def test_compare_and_explain_agree_on_both_sides(self):
        for a, b, arguments_a, arguments_b in (("usual", "internal", (), ("--internal",)),
                                               ("Selvin", "Quarro", (), ("--platform", "Quarro"))):
            result = self.machine.ctl("compare", a, b, "--json")
            self.assert_clean(result)
            compared = json.loads(result.out)
            sides = [self.explain(*arguments) for arguments in (arguments_a, arguments_b)]
            reported = [[line["verdict"] == "reported" for line in side] for side in sides]
            starts = sum(not was and is_now for was, is_now in zip(*reported))
            stops = sum(was and not is_now for was, is_now in zip(*reported))
            self.assertGreater(starts + stops, 0)
            self.assertEqual((compared["starts"], compared["stops"]), (starts, stops))
            listed = {kind: sum(change["count"] for change in compared["changes"] if change["change"] == kind)
                      for kind in ("start", "stop")}
            self.assertEqual(listed, {"start": starts, "stop": stops})
            for side, key in zip(sides, "ab"):
                self.assertEqual(compared[key]["reported"], sum(line["verdict"] == "reported" for line in side))

    def test_compare_tells_what_each_period_reports(self):
        self.machine.write_export([point("event", "com.vantor.Old", "A", "Gone", at=-90000),
                                   point("event", "com.vantor.Both", "A", "Stays", at=-90000),
                                   point("event", "com.vantor.Both", "A", "Stays", at=-50),
                                   point("event", "com.vantor.NoName", "A", at=-50),
                                   point("event", "com.vantor.Fresh", "A", "Comes", at=-50)], "b.export")
        result = self.machine.ctl("compare", "since=-26h,until=-24h", "last=2h", "--json")
        self.assert_clean(result)
        changes = {change["subsystem"]: (change["change"], change["count"], change["rule"])
                   for change in json.loads(result.out)["changes"]}
        self.assertEqual(changes["com.vantor.Old"], ("stop", 1, "not_recorded"))
        self.assertEqual(changes["com.vantor.Fresh"], ("start", 1, "not_recorded"))
        self.assertNotIn("com.vantor.Both", changes)
        text = self.machine.ctl("compare", "since=-26h,until=-24h", "last=2h").out
        self.assertRegex(text, r"(?m)^only in A\t1\tcom.vantor.Old / A / Gone\tnot recorded$")
        self.assertNotRegex(text, "would start|RULE|not_recorded|/ \t")

    def test_compare_counts_what_it_has_no_room_for(self):
        names = [*range(65_530), *range(65_520, 65_530), *range(65_530, 65_560)]
        self.machine.write_export(point("event", "com.vantor.Many", "A", f"N{name}", at=-90000 + i / 1000)
                                  for i, name in enumerate(names))
        arguments = ("compare", "since=-26h,until=-24h", "since=-1m")
        compared = json.loads(self.assert_clean(self.machine.ctl(*arguments, "--json")).out)
        self.assertEqual((compared["a"]["reported"], compared["objects_not_compared"]), (len(names), 24))
        self.assertEqual(compared["stops"], len(names) - 24)
        self.assertEqual(sum(change["count"] for change in compared["changes"]) + compared["changes_not_listed"],
                         compared["stops"])
        text = self.assert_clean(self.machine.ctl(*arguments)).out
        self.assertIn(f'{compared["changes_not_listed"]:,} objects had further changes', text.replace("\u202f", ","))
        self.assertIn("24 objects of further trace points not compared", text)


class Periods(ExplainTest):
    def test_a_period_is_what_the_arguments_say(self):
        hours = [1.5, 5.5, 23.5, 30.5, 50.5]
        self.machine.write_export([point("event", "com.vantor.A", "B", f"{hour}", at=-3600 * hour)
                                   for hour in reversed(hours)])
        stamp = time.strftime("%Y-%m-%dT%H:%M:%SZ", time.gmtime(self.machine.now - 3600 * 24))
        for arguments, wanted in (((), hours[:3]), (("--last", "2h"), hours[:1]), (("--since", "-2d"), hours[:4]),
                                  (("--since", "2 days ago", "--until", "5 hours ago"), hours[1:4]),
                                  (("--until", "-24h", "--last", "1d12h"), hours[3:]),
                                  (("--since", stamp), hours[:3]), (("--until", stamp), hours[3:4]),
                                  (("--since", f"@{int(self.machine.now - 7200)}"), hours[:1])):
            self.assertEqual([line["name"] for line in self.explain(*arguments)],
                             [f"{hour}" for hour in reversed(hours) if hour in wanted], arguments)


class Follow(ExplainTest):
    def append(self, entries):
        with open(os.path.join(self.machine.store, "live.export"), "ab") as file:
            file.writelines(export_bytes(entries, time.time(), first_sequence=self.sequence))
        self.sequence += len(entries)

    def shown(self, process, count):
        """The first `count` lines of --follow, and the seconds until they came."""
        began = time.monotonic()
        while time.monotonic() - began < 20:
            process.tessel_output.seek(0)
            lines = process.tessel_output.read().decode().splitlines()
            if len(lines) >= count:
                return [json.loads(line) for line in lines], time.monotonic() - began
            time.sleep(0.02)
        self.fail(f"{count} lines did not come: {lines}")

    def test_follow_shows_each_point_once(self):
        self.sequence = 1
        self.append([point("event", "com.vantor.Old", "A", "Before", at=-30)])
        process = self.machine.start("tesselctl", "explain", "--follow", "--json")
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        time.sleep(1.5)
        self.append([point("event", "com.vantor.Live", "A", "First", string1=("period", "weekly"), at=0)])
        lines, seconds = self.shown(process, 1)
        self.assertEqual((lines[0]["name"], lines[0]["verdict"], lines[0]["rule"]["value"]),
                         ("First", "string_whitelist", "weekly"))
        self.assertLess(seconds, 5 if harness.SANITIZED else 2)
        self.append([point("begin", "com.vantor.Live", "A", "Span", at=0)])
        time.sleep(1)
        self.append([point("end", "com.vantor.Live", "A", "Span", at=0),
                     point("event", "com.vantor.Live", "A", "Twin", at=0)])
        lines, _ = self.shown(process, 3)
        time.sleep(1.2)
        lines, _ = self.shown(process, 3)
        self.assertEqual([(line["name"], line["kind"]) for line in lines],
                         [("First", "Event"), ("Span", "Interval"), ("Twin", "Event")])

    def test_follow_waits_for_a_journal(self):
        folder = os.path.join(self.machine.root, "later")
        process = self.machine.start("tesselctl", "explain", "--follow", "--json", "--store", folder)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)

        def record(name, file, sequence):
            with open(os.path.join(folder, file + ".new"), "wb") as new:
                new.writelines(export_bytes([point("event", "com.vantor.Live", "A", name, at=0)], time.time(), sequence))
            os.rename(os.path.join(folder, file + ".new"), os.path.join(folder, file))

        def names(count):
            return [line["name"] for line in self.shown(process, count)[0]]

        time.sleep(0.6)
        os.mkdir(folder)
        time.sleep(0.6)
        open(os.path.join(folder, "a.journal"), "wb").close()  # as while the daemon makes it
        time.sleep(0.6)
        os.unlink(os.path.join(folder, "a.journal"))
        record("First", "a.export", 1)
        self.assertEqual(names(1), ["First"])
        os.rename(os.path.join(folder, "a.export"), os.path.join(folder, "a@1.export"))  # rotation
        record("Second", "a.export", 2)
        self.assertEqual(names(2), ["First", "Second"])
        for file in os.listdir(folder):
            os.unlink(os.path.join(folder, file))
        time.sleep(0.6)
        record("Third", "a.export", 3)
        self.assertEqual(names(3), ["First", "Second", "Third"])
        process.tessel_errors.seek(0)
        waits = process.tessel_errors.read().decode().splitlines()
        self.assertEqual([line.split(": ")[0] for line in waits], ["Waiting for a journal"] * 2, waits)
        self.assertIn(folder, waits[0])

    def test_follow_does_not_wait_for_a_file_to_change(self):
        text = os.path.join(self.machine.root, "letter.txt")
        with open(text, "w", encoding="utf-8") as file:
            file.write("no journal" * 99)
        result = self.machine.result(self.machine.start("tesselctl", "explain", "--follow", "--store", text), timeout=20)
        self.assertEqual((result.status, text in result.errors), (1, True), result.errors)

    LIVE = """
        "$0" explain --follow --json >"$1" & follower=$!
        sleep 1.5
        printf '%s\\n' MESSAGE=tessel TESSEL_KIND=event TESSEL_SUBSYSTEM=com.vantor.Calendar TESSEL_CATEGORY=View \
            TESSEL_NAME=Open TESSEL_TELEMETRY=1 TESSEL_STRING1_NAME=period TESSEL_STRING1_VALUE=weekly | logger --journald
        for _ in $(seq 200); do [ -s "$1" ] && break; sleep 0.05; done
        sleep 1; kill $follower
    """

    def test_follow_shows_what_logger_records(self):
        shown = os.path.join(self.machine.root, "shown")
        environment = self.machine.environment(TESSEL_TRACE_STORE=None)
        result = subprocess.run([os.path.join(os.path.dirname(os.path.abspath(__file__)), "with-journald"), "sh", "-c",
                                 self.LIVE, os.path.join(harness.BIN, "tesselctl"), shown],
                                env=environment, capture_output=True, text=True, check=False, timeout=120)
        self.assertTrue(os.path.exists(shown), result.stderr)
        with open(shown, encoding="utf-8") as file:
            lines = [json.loads(line) for line in file]
        self.assertEqual([(line["subsystem"], line["verdict"], line["rule"]["value"]) for line in lines],
                         [("com.vantor.Calendar", "string_whitelist", "weekly")], result.stderr)


class Reading(ExplainTest):
    def test_entries_without_object_are_counted_by_reason(self):
        self.machine.write_export([
            log_event("plain"), point("evnt", "a", "b"), Entry([("TESSEL_KIND", "event"), ("TESSEL_SUBSYSTEM", "a")]),
            point("event", "a", "b", duration="long"), point("end", "a", "b"), point("begin", "a", "b", "open")])
        summary = self.summary()
        self.assertEqual((summary["log_events"], summary["trace_objects"]), (6, 0))
        self.assertEqual(sum(summary["malformed"].values()), 3)
        self.assertEqual((summary["intervals"]["unmatched_ends"], summary["intervals"]["open"]), (1, 1))
        self.assertEqual([(os.path.basename(file["path"]), file["entries_read"]) for file in summary["files"]],
                         [("a.export", 6)])

    def test_what_the_store_lacks_is_told(self):
        self.machine.write_export([log_event("plain", at=-90), point("event", "a", "b", exe=None)])
        self.machine.write_export([Entry([("_TRANSPORT", "driver"), ("MESSAGE_ID", "a596d6fe7bfa4994828e72309e95d61e"), ("N_DROPPED", "7"),
                                          ("OBJECT_SYSTEMD_UNIT", "vantor.service")], at=-30)], "b.export",
                                  first_sequence=10)
        store = self.summary()["store"]
        self.assertEqual((store["sequence_gaps"], store["missing"], store["reaches_start"]), (1, 7, False))
        self.assertEqual(store["dropped"], [{"unit": "vantor.service", "count": 7}])
        self.assertEqual(self.summary()["without_exe"], 1)
        text = self.machine.ctl("explain", "--summary").out
        for words in ("reaches back to", "7 numbers of entries that no file holds: vacuumed, not exported or lost", "(vantor.service)", "\nThe program of 1 trace point is not known: the process was gone before the journal looked"):
            self.assertIn(words, text)
        self.machine.write_export([log_event("young", at=-80), log_event("dated back", at=-9e5), log_event("young", at=-70)])
        os.unlink(os.path.join(self.machine.store, "b.export"))
        self.assertEqual(self.summary()["store"]["missing"], 0, "the entry of another time has the number")

    def test_what_is_no_row_is_told_beside_the_rows(self):
        self.machine.write_export([log_event("plain"), point("begin", "com.vantor.A", "B", "Opens", at=-50),
                                   point("event", "com.vantor.A", "B", "Quiet", telemetry=False), point("evnt", "a", "b"),
                                   point("event", "com.vantor.A", "B", "Loud")])
        begin = "1 begin waits for its end, and is no trace object before: com.vantor.A / B / Opens\n"
        lost = "Lost: 1 malformed: unknown TESSEL_KIND\n"
        looked = "5 log events with 2 trace objects looked at, in " + self.machine.store + ", 20"
        off = "Reporting is off on this machine: there is no "
        for arguments, rows, said, unsaid in (
                ((), 2, [begin, lost], [looked, off]), (("--json",), 2, [], [begin, looked]),
                (("--name", "Qiet"), 0, [looked, "--name Qiet fits none of 3 names; near: Quiet\n"], [begin, off]),
                (("--name", "open*"), 0, [looked, "--name open* fits none of 3 names; near: Opens\n"], [begin]),
                (("--name", "Opens"), 0, [looked, begin], ["fits none", "each pattern"]),
                (("--name", "Quiet", "--verdict", "reported"), 0, ["each pattern fits something, but no trace object fits all"], []),
                (("--store", self.machine.store, "--last", "1s"), 0, ["No trace object: 0 log events looked at"], [off])):
            result = self.assert_clean(self.machine.ctl("explain", *arguments))
            self.assertEqual(result.out.count("\n"), rows, arguments)
            for words in said:
                self.assertIn(words, result.errors, arguments)
            for words in unsaid:
                self.assertNotIn(words, result.errors, arguments)
        self.machine.task('{"TaskedOn": false}')
        self.assertIn("Reporting is off on this machine: ", self.machine.ctl("explain").errors)
        self.assertNotIn("is off", self.machine.ctl("explain", "--store", self.machine.store).errors, "it may be another's")

    def test_a_damaged_file_is_named_and_the_rest_is_read(self):
        self.machine.write_export([point("event", "com.vantor.A", "B", "C")])
        with open(os.path.join(self.machine.store, "b.export"), "wb") as file:
            file.write(b"no equals sign\n\n")
            file.writelines(export_bytes([point("event", "com.vantor.D", "E", "F", at=-50)], self.machine.now,
                                         first_sequence=7))
        with open(os.path.join(self.machine.store, "c.journal"), "wb") as file:
            file.write(b"LPKSHHRH" + b"\xff" * 4096)
        summary = self.summary()
        self.assertEqual(summary["trace_objects"], 2)
        files = {os.path.basename(file["path"]): file for file in summary["files"]}
        self.assertTrue(files["b.export"]["problems"])
        self.assertTrue(files["c.journal"].get("skipped") or files["c.journal"]["problems"])


if __name__ == "__main__":
    harness.main()
