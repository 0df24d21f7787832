#!/usr/bin/env python3
"""Problems of `tesselctl status` that runs have, or that keep them away: each appears, and goes once it is over."""
import json
import os
import re
import time
import unittest

import harness
from harness import Entry, log_event, point, some_points, wait_for
from otlp_receiver import Answer
from status_case import CODES, STRANGER, UP_FOR_DAYS, Bus, StatusTest, up_for


class Documents(unittest.TestCase):
    def test_each_code_is_in_the_tables(self):
        read = lambda *path: open(os.path.join(os.path.dirname(__file__), "..", *path), encoding="utf-8").read()
        codes = re.findall(r'\{FindingCode::\w+,\s+"(\w+)"', read("src", "linux", "Findings.cpp"))
        self.assertEqual(codes[:len(CODES)], CODES)
        tables = read("docs", "operating.md").split("\n## Problems\n")[1].split("\n## ")[0]
        self.assertEqual(re.findall(r"(?m)^\| `(\w+)`", tables), codes)
        manual = read("packaging", "man", "tesselctl.1").split(".Ss tesselctl status")[1].split(".Ss ")[0]
        self.assertEqual(re.findall(r"(?m)^  ([a-z_]+)  ", manual), codes)


class LastRun(StatusTest):
    def test_a_failed_run_counts_until_the_next_good_one(self):
        self.service(TESSEL_TRACE_STORE="/nowhere")
        self.assertEqual(self.problems(), {"run_failed": None})
        self.assertIn("/nowhere", self.problem("run_failed")["words"])
        gone = {"TESSEL_TRACE_STORE": "/nowhere"}
        self.assertEqual(self.problems(**gone), {"store_unreadable": None, "run_failed": "store_unreadable"})
        self.machine.task('{"TaskedOn": false}')
        self.assertEqual(self.problems(), {"run_failed": None}, "no run came since")
        self.service()
        self.assertEqual(self.problems(), {}, "one came to its end, and had nothing to do")
        self.assertRegex(self.call("tesselctl", "status").out, "All in all +off +this machine reports nothing; 'tesselctl tasking on' switches reporting on; none of these")
        self.machine.task()
        self.assertEqual(self.problems(), {"run_failed": None}, "the last one that was to report")
        self.service()
        self.assertEqual(self.problems(), {})
        self.assertEqual(self.problems(**gone), {"store_unreadable": None}, "the next one would fail")
        self.assertRegex(self.call("tesselctl", "status").out, "Settings +set here +TESSEL_CONFIG_DIR, .*TESSEL_STATE_DIR.*systemctl cat")

    def test_refused_rows_and_why(self):
        self.service()
        self.spool("PRAGMA user_version = 99")
        self.service()
        self.assertEqual(self.problems(), {"rows_refused": None})
        self.spool("PRAGMA user_version = 1")
        self.service()
        self.assertEqual(self.problems(), {})
        self.machine.write_export([point("event", "com.vantor.A", "x", f"{i}" + 3000 * "x") for i in range(40)])
        self.fill_spool()
        self.service(TESSEL_SPOOL_LIMIT=str(4 << 20))
        self.assertEqual(self.problems(), {"rows_refused": "spool_filling", "spool_filling": None})
        self.spool("DELETE FROM events")
        self.assertEqual(self.problems(), {"rows_refused": None}, "the last run lost them all the same")
        self.service(TESSEL_SPOOL_LIMIT=str(4 << 20))
        self.assertEqual(self.problems(), {})

    def test_books_that_do_not_balance(self):
        for change in (lambda record: record.update(rows_stored=record["rows_stored"] - 1),
                       lambda record: record.update(inspected=record["inspected"] + 1)):
            self.service()
            self.assertEqual(self.problems(), {})
            self.change_record(change)
            self.assertEqual(self.problems(), {"books_unbalanced": None})

    def test_damage_and_refused_files_of_the_store(self):
        damaged, refused = (os.path.join(self.machine.store, name) for name in ("b.export", "c.journal"))
        with open(damaged, "wb") as file:
            file.write(b"no equals sign\n\n")
        self.machine.write_export([log_event("much later", at=-20)], "d.export", first_sequence=100)
        self.service()
        self.assertEqual(self.problems(), {"store_damaged": None})
        self.assertEqual([note["code"] for note in self.status()["notes"]], ["numbers_in_no_file"])
        os.rename(damaged, refused)
        self.service()
        self.assertEqual(self.problems(), {"store_unreadable": None})
        os.unlink(refused)
        self.service()
        self.assertEqual((self.problems(), self.status()["notes"]), ({}, []), "numbers without a loss beside them tell nothing")

    def test_expired_rows_count_once_a_forwarder_delivered(self):
        old = lambda: self.spool("INSERT INTO events(time, name, payload) VALUES(1, 'x', '{}')")
        self.service()
        old()
        self.service()
        self.assertEqual((self.machine.record()["rows_expired"], self.problems()), (1, {}))
        self.forward(Answer())
        self.assertEqual(self.machine.rows(), [])
        old()
        self.service()
        self.assertEqual(self.problems(), {"rows_expired": None})
        self.service()
        self.assertEqual(self.problems(), {})
        old()
        self.machine.task('{"TaskedOn": false}')
        before = self.machine.record()
        self.service()
        self.assertEqual((self.problems(), self.machine.record()["end"]), ({"rows_expired": None}, before["end"]))

    def test_what_anybody_can_cause_is_a_note(self):
        old = log_event("old", at=-90000)
        bad = Entry([("TESSEL_KIND", "event")], at=-50)
        dropped = Entry([("_TRANSPORT", "driver"), ("MESSAGE_ID", "a596d6fe7bfa4994828e72309e95d61e"), ("N_DROPPED", "7")], at=-30)
        lost = Entry([("TESSEL_LOST", "5"), ("TESSEL_LOST_SINCE", str(int((self.machine.now - 60) * 1e6)))], uid=1000)
        begins = [point("begin", "com.vantor.A", "B", interval=at, attributes=[("a", "b")] * 32) for at in range(8200)]
        for entries, *codes in (([old, lost], "lost_at_source"), ([old, dropped], "dropped_by_daemon"), ([old, *begins], "over_share"),
                                ([old, bad], "malformed"), ([log_event("young")], "store_begins_late")):
            self.machine.write_export(entries)
            self.service()
            status = self.status()
            self.assertEqual(([note["code"] for note in status["notes"]], status["good"]), (codes, True))
            self.machine.write_export([old] + some_points(1))
            self.service()
            self.assertEqual(self.status()["notes"], [], codes)
        self.change_record(lambda record: record.update(outcome="interrupted"))
        self.assertEqual([note["code"] for note in self.status()["notes"]], ["run_cut_short"])
        text = self.call("tesselctl", "status").out
        self.assertLess(text.index("run_cut_short "), text.index("All in all"))


class Runs(StatusTest):
    def kill_a_run(self):
        self.machine.write_export(some_points(400))
        process = self.machine.start()
        wait_for(lambda: self.machine.marker_exists() and self.machine.rows())
        status = self.status()
        self.assertEqual((status["good"], status["next_run"]["by"], status["runs"][-1]["outcome"]),
                         (True, "under_way", "under_way"))
        process.kill()
        process.wait()
        self.assertEqual(self.status()["runs"][-1]["outcome"], "died")

    def test_two_of_four_that_died_or_read_nothing(self):
        self.service()
        figures = self.machine.record()
        self.kill_a_run()
        self.assertEqual(self.problems(), {}, "one of two")
        self.assertEqual(self.status()["last_run"]["end"], figures["end"], "the figures of the run before stay")
        self.machine.write_export(some_points(1))
        self.service()
        self.assertEqual(self.problems(), {"bailed_out": None})
        self.service()
        self.assertEqual(self.problems(), {}, "the last run was good")
        self.assertEqual([run["outcome"] for run in self.status()["runs"]], ["completed", "died", "bailed_out", "completed"])

    def test_an_untasked_run_and_an_older_record(self):
        self.service()
        def older(record):
            for key in ("runs", "expired_since"):
                del record[key]
        self.change_record(older)
        before = self.machine.record()
        self.machine.task('{"TaskedOn": false}')
        self.service()
        self.assertEqual((self.machine.record(), self.problems()), (before, {}))
        self.machine.task()
        self.service()
        self.assertEqual([run["outcome"] for run in self.status()["runs"]], ["completed", "completed"])

    def test_a_damaged_record_is_said_and_replaced(self):
        self.service()
        self.age(self.tasking_file(), 20)
        with open(self.state("last_run.json"), "r+", encoding="utf-8") as file:
            file.truncate(100)
        status = self.status(before=UP_FOR_DAYS)
        self.assertTrue(status["good"], "the scheduler knows of the run, so nobody may say that there was none")
        self.assertEqual(("last_run" in status, status["runs"]), (False, []))
        self.assertIn("it is damaged", self.call("tesselctl", "status").out)
        self.service()
        self.assertEqual(len(self.status()["runs"]), 1)


class NoRun(StatusTest):
    before = UP_FOR_DAYS

    def test_a_day_and_a_half_without_a_run(self):
        self.service()
        self.age(self.tasking_file(), 20)
        self.shift_runs(-1.4)
        self.assertEqual(self.problems(), {})
        self.shift_runs(-0.2)
        self.assertEqual(self.problems(), {"no_completed_run": None})
        self.assertEqual(self.problems(before=up_for(3600)), {})
        self.assertEqual(self.machine.ctl("defer", "on").status, 0)
        self.age(self.state("defer"), 2)
        self.assertEqual(self.problems(), {"deferred": None, "no_completed_run": "deferred"})
        text = re.sub(r"\s+", " ", self.call("tesselctl", "status").out)
        self.assertRegex(text, r"Problem deferred .* Hence no_completed_run: No run has reported for")
        self.machine.ctl("defer", "off")
        self.machine.task()
        self.assertEqual(self.problems(), {}, "counted from tasking on")
        self.age(self.tasking_file(), 20)
        self.service()
        self.assertEqual(self.problems(), {})

    def test_what_follows_from_an_effect_is_shown_too(self):
        self.service()
        self.age(self.tasking_file(), 20)
        marker = os.path.join(self.machine.var_tmp, harness.MARKER)
        open(marker, "w", encoding="utf-8").close()
        os.chown(marker, STRANGER, STRANGER)
        self.change_record(lambda record: record.update(outcome="failed", failure="the run marker stays"))
        self.change_record(lambda record: record["runs"][0].update(outcome="failed"))
        self.shift_runs(-2)
        self.assertEqual(self.problems(), {"marker_stuck": None, "run_failed": "marker_stuck", "no_completed_run": "run_failed"})
        text = re.sub(r"\s+", " ", self.call("tesselctl", "status").out)
        self.assertRegex(text, r"Problem marker_stuck .* Hence run_failed: .* Hence no_completed_run: No run")

    def test_one_that_never_ran_counts_from_tasking_on(self):
        self.assertEqual(self.problems(), {})
        self.age(self.tasking_file(), 2)
        self.assertEqual(self.problems(), {"no_completed_run": None})
        self.machine.task('{"TaskedOn": false}')
        self.age(self.tasking_file(), 2)
        self.assertEqual(self.problems(), {})
        self.service()
        self.machine.task()
        self.age(self.tasking_file(), 2)
        self.assertEqual(self.problems(), {}, "a run of today was not tasked, whatever the file's time")

    def test_a_tasking_file_that_is_written_every_hour(self):
        for _ in range(3):
            self.machine.task()
            self.service()
        self.shift_runs(-10)
        self.machine.task()
        self.assertEqual(self.problems(), {"no_completed_run": None})

    def test_a_clock_that_was_set_is_no_day_without_a_run(self):
        self.service()
        self.age(self.tasking_file(), 20)
        self.shift_runs(-10, "boot_began")
        self.assertEqual(self.problems(), {}, "set forward by ten days since the run")
        self.shift_runs(+20, "boot_began")
        self.assertEqual(self.problems(), {}, "set back by ten days since the run")
        def other_boot(record):
            record["runs"][0]["boot"] = "another"
        self.change_record(other_boot)
        self.assertEqual(self.problems(), {"no_completed_run": None}, "known is only that it is up for four days")


class NextRun(StatusTest):
    def test_the_timer_says_when(self):
        os.mkdir(os.path.join(self.machine.var_lib, "tessel"))
        path = os.path.join(self.machine.root, "bus")
        address = {"TESSEL_STATE_DIR": None, "DBUS_SYSTEM_BUS_ADDRESS": "unix:path=" + path}
        self.assertEqual(self.status(**address)["next_run"], {"by": "nothing"}, "nobody answers")
        self.assertRegex(self.call("tesselctl", "status", **address).out, r"Next run +unknown +no service manager answers")
        for tasked, word, notes in ((True, "idle", ["nothing_starts_runs"]), (False, "off", [])):
            self.machine.task(json.dumps({"TaskedOn": tasked}))
            Bus(path, 0)
            text = self.call("tesselctl", "status", **address).out
            self.assertRegex(text, r"(?s)Next run +unknown +tessel-reporter.timer is not active; 'systemctl.*All in all +" + word)
            os.unlink(path)
            Bus(path, 0)
            status = self.status(**address)
            self.assertEqual((status["good"], [note["code"] for note in status["notes"]]), (True, notes))
            os.unlink(path)
        self.machine.task()
        at = int((time.time() + 7200) * 1e6)
        bus = Bus(path, at)
        self.assertEqual(self.status(**address)["next_run"], {"by": "timer", "at": at})
        self.assertIn(b"/org/freedesktop/systemd1/unit/tessel_2dreporter_2etimer\0", bus.asked)

    def test_the_interval_of_the_service_that_ran(self):
        process = self.machine.start(TESSEL_ACTIVITY_INTERVAL="3600")
        wait_for(lambda: os.path.exists(self.state("scheduler-last-run")))
        harness.interrupt(process)
        self.assert_clean(self.machine.result(process))
        status = self.status()
        self.assertEqual(status["next_run"], {"by": "interval", "at": status["last_begin"] + int(3600e6)})


if __name__ == "__main__":
    harness.main()
