#!/usr/bin/env python3
"""tesselctl for people and scripts: exit statuses, the spool, the state of the machine."""
import contextlib
import json
import os
import re
import sqlite3
import subprocess
import time

import harness
from harness import BIN, Entry, MachineTest, export_bytes, log_event, point
from otlp_receiver import Answer, Receiver


class CtlTest(MachineTest):
    def spool(self):
        return os.path.join(self.machine.state, "statora.db")

    def as_nobody(self, *arguments):
        return subprocess.run([os.path.join(BIN, "tesselctl"), *arguments], env=self.machine.environment(),
                              capture_output=True, text=True, user=65534, group=65534, extra_groups=[], check=False)


class Statuses(CtlTest):
    def test_without_access_the_hint_says_what_to_do(self):
        harness.require_root()
        self.machine.write_export([log_event("x")])
        for folder, mode in ((self.machine.root, 0o755), (self.machine.config, 0o755), (self.machine.store, 0o700),
                             (self.machine.state, 0o700)):
            os.chmod(folder, mode)
        for arguments in (("explain",), ("events",), ("status",), ("defer", "on"), ("tasking", "on"),
                          ("report", "--html", os.path.join(self.machine.config, "page.html"))):
            result = self.as_nobody(*arguments)
            self.assertEqual(result.returncode, 4, (arguments, result.stderr))
            self.assertIn("ermission denied", result.stderr)
            self.assertRegex(result.stderr, "; run tesselctl as root|; run tesselctl as a user who may read the store|; sudo tesselctl status shows all")
            self.assertEqual(result.stderr.count("\n"), 1)
        os.chmod(self.machine.store, 0o755)
        os.close(os.open(os.path.join(self.machine.store, "closed.export"), os.O_CREAT, 0o600))
        self.assertEqual(self.as_nobody("explain").returncode, 4, "one file of two was read")


class Events(CtlTest):
    def setUp(self):
        super().setUp()
        self.machine.write_export([point("event", "com.vantor.A", "x", "One", number1=("n", "0.1")),
                                   point("event", "com.vantor.B", "y", "Two")])
        self.assert_clean(self.machine.run())

    def events(self, *arguments):
        result = self.machine.ctl("events", "--json", *arguments)
        self.assertEqual((result.status, result.errors), (0, ""))
        return [json.loads(line, object_pairs_hook=list) for line in result.out.splitlines()]

    def test_they_are_the_rows_in_order(self):
        rows = self.machine.rows()
        self.assertGreater(len(rows), 5)
        shown = [dict(event) for event in self.events()]
        self.assertEqual([(event["name"], event["payload"]) for event in shown], rows)
        self.assertEqual([event["id"] for event in shown], list(range(1, len(rows) + 1)))
        self.assertEqual(len(self.machine.ctl("events").out.splitlines()), len(rows))

    def test_filters(self):
        names = lambda *arguments: [dict(event)["name"] for event in self.events(*arguments)]
        rows = [name for name, _ in self.machine.rows()]
        self.assertEqual(names("--name", "ts__*"), ["ts__com.vantor.A__x__One", "ts__com.vantor.B__y__Two"])
        self.assertEqual(names("--subsystem", "com.vantor.B", "--name", "*.tessel"), ["com.vantor.performance.tessel"])
        self.assertEqual(names("--category", "x", "--name", "ts__*"), ["ts__com.vantor.A__x__One"])
        self.assertEqual(names("-n", "2"), rows[-2:])
        self.assertEqual(names("--last", "1h"), rows)
        self.assertEqual(names("--until", "-1h"), [])

    def test_follow_goes_on_with_a_replaced_spool(self):
        process = self.machine.start("tesselctl", "events", "--follow", "--json", "-n", "1")
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)

        def wait_for_name(name):
            for _ in range(500):
                process.tessel_output.seek(0)
                if f'"name":"{name}"'.encode() in process.tessel_output.read():
                    return
                time.sleep(0.02)
            self.fail(f"{name} did not show up")

        wait_for_name("com.vantor.performance.tessel_reporting_stats")
        with contextlib.closing(sqlite3.connect(self.spool())) as database, database:
            database.execute("INSERT INTO events(time, name, payload) VALUES(1, 'added', '{}')")
        wait_for_name("added")
        os.rename(self.spool(), self.spool() + ".aside")
        with contextlib.closing(sqlite3.connect(self.spool() + ".new")) as database, database:
            database.execute("CREATE TABLE events(id INTEGER PRIMARY KEY AUTOINCREMENT, time INTEGER NOT NULL,"
                             " name TEXT NOT NULL, payload TEXT NOT NULL)")
            database.execute("INSERT INTO events(time, name, payload) VALUES(1, 'of the new spool', '{}')")
        os.rename(self.spool() + ".new", self.spool())
        wait_for_name("of the new spool")

    def test_a_reader_who_may_only_read_sees_them(self):
        harness.require_root()
        for path, mode in ((self.machine.root, 0o755), (self.machine.state, 0o755), (self.spool(), 0o644)):
            os.chmod(path, mode)
        result = self.as_nobody("events")
        self.assertEqual((result.returncode, len(result.stdout.splitlines())), (0, len(self.machine.rows())), result.stderr)
        self.assertEqual([name for name in os.listdir(self.machine.state) if name.startswith("statora.db-")], [])


class Status(CtlTest):
    def status(self, **extra):
        result = self.machine.ctl("status", "--json", **extra)
        self.assertEqual(result.errors, "")
        return result.status, json.loads(result.out)

    def record(self):
        return os.path.join(self.machine.state, "last_run.json")

    def change_record(self, **changes):
        with open(self.record(), encoding="utf-8") as file:
            record = json.load(file)
        record.update(changes)
        with open(self.record(), "w", encoding="utf-8") as file:
            json.dump(record, file)

    def run_once(self):
        self.machine.write_export([point("event", "com.vantor.A", "x", "One"), point("event", "com.vantor.A", "x", None),
                                   point("event", "com.vantor.A", "x", "Two", telemetry=False)])
        self.assert_clean(self.machine.run())

    def test_a_machine_that_never_ran_is_said_to_be_that(self):
        self.machine.write_export([log_event("x")])
        exit_status, status = self.status()
        self.assertEqual((exit_status, status["spool"]["state"], "last_run" in status), (0, "absent", False))
        self.assertEqual(os.listdir(self.machine.state), [])

    def test_forwarder_counters_show_once_it_worked(self):
        self.run_once()
        self.assertNotIn("forwarder", self.status()[1])
        with Receiver(lambda request, number: Answer(503 if number == 0 else 200)) as receiver:
            subprocess.run([os.path.join(BIN, "statora_forwarder"), "--once"], check=True, capture_output=True,
                           env={"TESSEL_STATE_DIR": self.machine.state, "OTEL_EXPORTER_OTLP_ENDPOINT": receiver.url,
                                "TESSEL_FORWARD_RATE": "0", "TESSEL_FORWARD_RETRY": "1"})
        exit_status, status = self.status()
        delivered = len(receiver.accepted_uids())
        self.assertEqual(exit_status, 0, "the run's books balance although the rows are gone")
        self.assertEqual(status["spool"]["rows"], 0)
        self.assertGreater(delivered, 0)
        forwarder = status["forwarder"]
        self.assertEqual([forwarder[key] for key in ("delivered", "requests", "retries", "set_aside", "position")],
                         [delivered, 2, 1, 0, delivered])
        self.assertIn(f"{delivered} delivered in 2 requests", self.machine.ctl("status").out)

    def test_the_figures_of_the_last_run(self):
        self.run_once()
        exit_status, status = self.status()
        run = status["last_run"]
        self.assertEqual((exit_status, status["good"], run["objects_balance"], run["rows_balance"]), (0, True, True, True))
        self.assertEqual((run["inspected"], run["reported"], run["telemetry_disabled"], run["unnamed"]), (3, 2, 1, 1))
        self.assertEqual(run["rows_stored"], len(self.machine.rows()))
        self.assertEqual(status["spool"]["rows"], len(self.machine.rows()))

    def test_losses_of_the_last_runs_store_are_told(self):
        self.machine.write_export([log_event("old", at=-90000), point("event", "com.vantor.A", "x", "One")])
        self.assert_clean(self.machine.run())
        self.assertRegex(self.machine.ctl("status").out, r"Store +whole +1 file and 1 entry read\n\S")

        self.machine.write_export([log_event("plain", at=-90), point("event", "com.vantor.A", "x", "Two", exe=None)])
        self.machine.write_export([Entry([("_TRANSPORT", "driver"), ("MESSAGE_ID", "a596d6fe7bfa4994828e72309e95d61e"), ("N_DROPPED", "7"),
                                          ("OBJECT_SYSTEMD_UNIT", "vantor.service")], at=-30)], "b.export",
                                  first_sequence=10)
        damaged, refused = (os.path.join(self.machine.store, name) for name in ("c.export", "\x1bd.journal"))
        with open(damaged, "wb") as file:
            file.write(b"no equals sign\n\n")
            file.writelines(export_bytes([log_event("after it", at=-20)], self.machine.now, first_sequence=11))
        with open(refused, "wb") as file:
            file.write(b"this is a letter" * 64)
        self.assert_clean(self.machine.run())
        summary = json.loads(self.machine.ctl("explain", "--summary", "--json").out)
        exit_status, status = self.status()
        codes = [[found["code"] for found in status[kind]] for kind in ("problems", "notes")]
        self.assertEqual((exit_status, status["good"], codes), (1, False, [["store_unreadable", "store_damaged"],
                                                                           ["dropped_by_daemon", "numbers_in_no_file", "store_begins_late"]]))
        reading = status["last_run"]["reading"]
        for told in (reading, summary):
            self.assertTrue(told["store"].pop("range_start"))  # of a moment of its own
        for key in ("store", "malformed", "beyond_pair_limit", "without_exe"):
            self.assertEqual(reading[key], summary[key])
        self.assertEqual(reading["losses"], json.loads(json.dumps(summary["losses"]).replace("\\u001b", "\\\\x1b")))
        self.assertEqual(json.loads(self.machine.ctl("compare", "usual", "internal", "--json").out)["losses"], summary["losses"])
        self.assertEqual((reading["store"]["missing"], reading["store"]["dropped"], reading["without_exe"]),
                         (7, [{"unit": "vantor.service", "count": 7}], 1))
        files = {file["path"]: file for file in summary["files"]}
        self.assertEqual(reading["files"], [{"path": refused.replace("\x1b", "\\x1b"), "skipped": files[refused]["skipped"]}])
        problem = files[damaged]["problems"][0]
        self.assertEqual(reading["problems"], [{"path": damaged, "files": 1, **problem}])
        text = re.sub(r"\s+", " ", self.machine.ctl("status").out)
        for words in ("Store not whole 3 files and 4 entries read The store reaches back to",
                      "7 entries_missing: numbers that no file holds: vacuumed, not exported or lost, in 1 gap", "7 dropped_by_daemon: ", "(vantor.service)",
                      "The program of 1 trace point is not known: the process was gone before the journal looked", f"1 file_skipped: {files[refused]['skipped']} (",
                      "\\x1bd.journal", f"1 file_damaged: {problem['reason']} (", "byte 0)"):
            self.assertIn(words, text)

    def test_a_record_without_a_reading_shows_no_store(self):
        self.run_once()
        self.change_record(reading=None)
        self.assertNotIn("last_run", self.status()[1], "a damaged record is none")
        self.run_once()
        with open(self.record(), encoding="utf-8") as file:
            record = json.load(file)
        del record["reading"]
        with open(self.record(), "w", encoding="utf-8") as file:
            json.dump(record, file)
        self.assertNotIn("reading", self.status()[1]["last_run"])
        shown = self.machine.ctl("status")
        self.assert_clean(shown)
        self.assertNotIn("Store", shown.out)

    def test_it_says_what_the_next_run_will_meet(self):
        self.machine.write_export([log_event("old", at=-90000), log_event("new")])
        self.assertEqual(self.status()[1]["deferral"], {"wanted": False})
        self.assertTrue(self.status()[1]["journal"]["keeps_a_day"])
        self.assertEqual(self.machine.ctl("defer", "on").status, 0)
        self.machine.write_export([log_event("new")])
        status = self.status()[1]
        self.assertTrue(status["deferral"]["wanted"])
        self.assertIn("/defer", status["deferral"]["reason"])
        self.assertFalse(status["journal"]["keeps_a_day"])

    def markers(self):
        marker = self.status()[1]["marker"]
        return marker["present"], marker.get("owner"), [(place["of"], place["state"]) for place in marker["places"]]

    def test_markers_of_the_unit_and_of_a_run_by_hand(self):
        harness.require_root()
        self.assertEqual(self.markers(), (False, None, [("by_hand", "absent")]))
        directory = os.path.join(self.machine.var_lib, "tessel-marker")
        os.mkdir(directory, 0o700)
        by_hand = os.path.join(self.machine.var_tmp, harness.MARKER)
        os.symlink("/nowhere", by_hand)
        os.chown(by_hand, 54321, 54321, follow_symlinks=False)
        self.assertEqual(self.markers(), (True, "54321", [("unit", "absent"), ("by_hand", "present")]))
        shown = self.machine.ctl("status").out
        self.assertRegex(shown, r"Marker +none +no run under the unit is reporting")
        self.assertRegex(shown, r"Marker +present +/var/tmp/tessel_reporter_running of 54321")
        open(os.path.join(directory, harness.MARKER), "w", encoding="utf-8").close()
        self.assertEqual(self.markers(), (True, "root", [("unit", "present"), ("by_hand", "present")]))
        os.unlink(by_hand)
        self.assertRegex(self.machine.ctl("status").out, r"Marker +present +/var/lib/tessel-marker/tessel_reporter_running of root")
        for folder in (self.machine.root, self.machine.state):
            os.chmod(folder, 0o755)
        nobody = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", os.path.join(BIN, "tesselctl"), "status"]
        for arguments, said in (([], "tessel_reporter_running cannot be seen"), (["--json"], '"state":"cannot_be_seen"')):
            result = subprocess.run(
                harness.in_namespace_argv(self.machine.var_tmp, nobody + arguments, var_lib=self.machine.var_lib),
                env=self.machine.environment(), capture_output=True, text=True, check=False)
            self.assertIn(said, re.sub(r"\s+", " ", result.stdout), result.stderr)


if __name__ == "__main__":
    harness.main()
