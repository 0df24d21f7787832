#!/usr/bin/env python3
"""Problems of `tesselctl status` that the machine and the spool have: each appears, and goes once all is well."""
import json
import os
import signal
import subprocess
import time

import harness
from harness import BIN, log_event, some_points, wait_for
from otlp_receiver import Answer, Receiver
from status_case import NOBODY, STRANGER, StatusTest, up_for


class Machine(StatusTest):
    def test_a_marker_that_is_not_the_services_own(self):
        self.service()
        marker = os.path.join(self.machine.var_tmp, harness.MARKER)
        open(marker, "w", encoding="utf-8").close()
        self.assertEqual(self.problems(), {}, "one of a run that died, and the next run removes it")
        os.chown(marker, STRANGER, STRANGER)
        self.assertEqual(self.problems(), {"marker_stuck": None})
        self.assertEqual(self.problem("marker_stuck")["command"], f"rm -rf /var/tmp/{harness.MARKER}")
        os.chown(marker, 0, 0)
        self.change_record(lambda record: record.update(marker="still there"))
        self.assertEqual(self.problems(), {"marker_stuck": None})
        os.unlink(marker)
        self.assertEqual(self.problems(), {})

    def test_a_strangers_marker_beside_the_units_runs(self):
        for name in ("tessel", "tessel-marker"):
            os.mkdir(os.path.join(self.machine.var_lib, name))
        marker = os.path.join(self.machine.var_tmp, harness.MARKER)
        open(marker, "w", encoding="utf-8").close()
        os.chown(marker, STRANGER, STRANGER)
        self.assertEqual(self.problems(TESSEL_STATE_DIR=None), {}, "any user can put one there, and it stops no run")
        os.rename(marker, os.path.join(self.machine.var_lib, "tessel-marker", harness.MARKER))
        self.assertEqual(self.problems(TESSEL_STATE_DIR=None), {"marker_stuck": None})

    def test_a_deferral_of_a_day(self):
        self.service()
        self.machine.ctl("defer", "on")
        self.age(self.state("defer"), 0.9)
        self.assertEqual(self.problems(), {})
        self.age(self.state("defer"), 1.1)
        self.assertEqual(self.problems(), {"deferred": None})
        self.assertEqual(self.problems(TESSEL_DEFER_ON=""), {}, "it defers nothing")
        self.age(self.state("defer"), -5)
        self.assertEqual(self.problems(), {}, "the clock was set")
        self.age(self.state("defer"), 5)
        self.machine.ctl("defer", "off")
        self.assertEqual(self.problems(), {})
        pressure = os.path.join(self.machine.root, "cpu")
        by_machine = {"before": ("/bin/sh", "-c", f'mount -n --bind {pressure} /proc/pressure/cpu && exec "$0" "$@"'),
                      "TESSEL_DEFER_ON": "pressure"}
        for avg10, hours, problems in (("99.00", 23, {}), ("99.00", 25, {"deferred": None}), ("0.00", 25, {})):
            with open(pressure, "w", encoding="utf-8") as file:
                file.write(f"some avg10={avg10} avg60=0.00 avg300=0.00 total=0\n")
            with open(self.state("scheduler-put-off"), "w", encoding="utf-8") as file:
                file.write(f"{hours * 3600}\n")
            self.assertEqual(self.problems(**by_machine), problems, (avg10, hours))

    def test_a_state_directory_that_cannot_be_written(self):
        self.service()
        self.machine.read_only = [self.machine.state]
        self.assertEqual(self.problems(), {"record_unwritable": None})
        self.machine.read_only = []
        self.assertEqual(self.problems(), {})
        os.unlink(self.state("last_run.json"))
        os.mkdir(self.state("last_run.json"))
        self.assertIn("record_unwritable", self.problems())
        os.rmdir(self.state("last_run.json"))
        self.service()
        self.assertEqual(self.problems(), {})
        def without_end(record):
            del record["runs"][-1]["end"], record["runs"][-1]["outcome"]
        self.change_record(without_end)
        self.assertEqual(self.problems(), {"record_unwritable": None}, "the scheduler knows that this run ended well")
        self.service()
        self.assertEqual(self.problems(), {})

    def test_root_and_the_services_user_see_the_same(self):
        for folder in (self.machine.root, self.machine.store, self.machine.config):
            os.chmod(folder, 0o755)
        os.chmod(self.tasking_file(), 0o600)
        os.chown(self.machine.state, 65534, 65534)
        self.assertEqual(self.problems(), {"tasking_unreadable": None})
        self.assertEqual(self.problems(before=NOBODY), {"tasking_unreadable": None})
        os.chmod(self.tasking_file(), 0o644)
        self.assertEqual((self.problems(), self.problems(before=NOBODY)), ({}, {}))
        os.chmod(self.machine.state, 0o500)
        self.assertEqual((self.problems(), self.problems(before=NOBODY)), ({"record_unwritable": None},) * 2)

    def test_another_user_is_told_that_he_may_not_look(self):
        self.service()
        for folder, mode in ((self.machine.root, 0o755), (self.machine.state, 0o700)):
            os.chmod(folder, mode)
        result = self.call("tesselctl", "status", "--json", before=NOBODY)
        status = json.loads(result.out)
        self.assertEqual((result.status, status["good"], [found["code"] for found in status["problems"]]),
                         (4, False, ["no_access"]))
        self.assertRegex(self.call("tesselctl", "status", before=NOBODY).out, "Last run +no access .*Permission denied")
        self.assertNotIn("no_completed_run", status["checked"])
        for folder in (self.machine.state, self.machine.store, self.machine.config):
            os.chmod(folder, 0o755)
        os.chmod(self.state("last_run.json"), 0o644)
        os.chmod(self.state("statora.db"), 0o644)
        self.assertEqual(self.status(before=NOBODY)["problems"], [])

    def test_a_tasking_file_that_says_nothing(self):
        for text in ('{"TaskedOn": "yes"}', "{"):
            self.machine.task(text)
            self.assertEqual(self.problems(), {"tasking_unreadable": None})
        self.machine.task('{"TaskedOn": false}')
        self.assertEqual(self.problems(), {})

    def test_a_file_in_the_place_of_the_state_directory(self):
        os.rmdir(self.machine.state)
        open(self.machine.state, "w", encoding="utf-8").close()
        self.assertIn("record_unwritable", self.problems())
        self.assertIn("Not a directory", self.problem("record_unwritable")["words"])

    def test_an_export_file_may_hold_older_entries(self):
        self.machine.write_export(some_points(1) + [log_event("old", at=-90000)])
        self.assertRegex(self.call("tesselctl", "status").out, r"Journal +part of day +\S+: first entry .* may hold older entries further on")

    def test_without_a_state_directory(self):
        os.rmdir(self.machine.state)
        self.assertEqual(self.problems(), {})
        self.assertEqual(self.status()["spool"]["state"], "absent")
        self.assertFalse(os.path.exists(self.machine.state))


class Spool(StatusTest):
    def test_a_spool_that_fills(self):
        self.service(TESSEL_SPOOL_LIMIT=str(4 << 20))
        self.fill_spool(0.75)
        self.assertEqual(self.problems(), {})
        self.fill_spool(0.1)
        self.assertEqual(self.problems(), {"spool_filling": None}, "though this shell has the default limit")
        self.assertRegex(self.call("tesselctl", "status").out, r"Spool +\d+ rows +.* 8\d % of its limit")
        self.spool("DELETE FROM events WHERE id % 2")
        self.assertEqual(self.problems(), {})

    def test_a_damaged_spool_until_a_run_began_a_new_one(self):
        self.service()
        with open(self.state("statora.db"), "r+b") as file:
            file.write(os.urandom(4096))
        self.assertEqual(self.problems(), {"spool_damaged": None})
        self.service()
        status = self.status()
        self.assertEqual((status["problems"], [note["code"] for note in status["notes"]]), ([], ["spool_set_aside"]))
        self.service()
        self.assertEqual(self.status()["notes"], [])

    def test_a_forwarder_that_delivers_nothing(self):
        self.service()
        late = lambda: self.spool("UPDATE events SET time = time - ?", int(3 * 3600 * 1e6))
        late()
        self.assertEqual(self.problems(), {}, "there is no forwarder")
        self.assertRegex(self.call("tesselctl", "status").out, r"Spool +\d+ rows wait .*\nForwarder +none ")
        self.forward(Answer(401, b"who are you?"))
        self.assertRegex(self.call("tesselctl", "status").out, r"Forwarder +in vain +0 delivered .*; the last try, .* ago\): 401: who are you\?\n")
        self.assertEqual(self.problems(), {"forwarder_stuck": None})
        self.assertEqual(self.problems(before=up_for(60)), {}, "a machine that was off could not deliver")
        self.assertRegex(self.problem("forwarder_stuck")["words"], r"nothing for 3.h, .*events wait; the last error, \d+.s ago: 401: who are you\?$")
        self.spool("INSERT OR REPLACE INTO forwarder VALUES('ordered_until', ?)", int((time.time() + 60) * 1e6))
        self.assertEqual(self.problems(), {}, "the collector asked for this wait")
        self.spool("UPDATE forwarder SET value = 1 WHERE name = 'ordered_until'")
        self.fill_spool(0.9)
        self.spool("UPDATE meta SET value = ? WHERE key = 'limit_bytes'", str(4 << 20))
        self.assertEqual(self.problems(), {"forwarder_stuck": None, "spool_filling": "forwarder_stuck"})
        self.forward(Answer())
        self.assertEqual(self.problems(), {})
        self.service()
        self.assertEqual(self.problems(), {}, "rows of this moment wait")

    def test_a_forwarder_may_wait_by_its_settings(self):
        self.service()
        hours = lambda count: int((time.time() + count * 3600) * 1e6)
        self.spool("UPDATE events SET time = ?", hours(-3))
        self.forward(Answer(401))
        self.assertEqual(self.problems(), {"forwarder_stuck": None})
        process = subprocess.Popen([os.path.join(BIN, "statora_forwarder")], stderr=subprocess.DEVNULL,
                                   env=self.machine.environment(OTEL_EXPORTER_OTLP_ENDPOINT="http://localhost:1",
                                                                TESSEL_FORWARD_SPREAD="31536000"))
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        wait_for(lambda: self.status()["forwarder"].get("next_attempt", 0) > hours(0))
        process.kill()
        process.wait()
        self.assertEqual(self.problems(), {}, "it waits for its turn in the fleet")
        for since, until, problems in ((-9, -1, {}), (-9, -2.1, {"forwarder_stuck": None}),
                                       (1, 9, {"forwarder_stuck": None}), (-1, 9, {})):
            self.spool("INSERT OR REPLACE INTO forwarder VALUES('rests_since', ?), ('next_attempt', ?)", hours(since), hours(until))
            self.assertEqual(self.problems(), problems, (since, until))
        self.forward(Answer(401))
        self.assertLessEqual(self.status()["forwarder"]["next_attempt"], hours(0), "the wait ended with this attempt")
        self.forward(Answer(), TESSEL_FORWARD_INTERVAL="86400")
        self.service()
        self.spool("UPDATE events SET time = ?", hours(-3))
        self.spool("UPDATE forwarder SET value = ? WHERE name = 'last_success'", hours(-4))
        self.assertEqual(self.problems(), {}, "it looks once a day")

    def test_a_wait_that_the_collector_orders_is_noted(self):
        self.service()
        with Receiver(lambda request, number: Answer(503, headers={"Retry-After": "600"})) as receiver:
            process = subprocess.Popen([os.path.join(BIN, "statora_forwarder"), "--once"], stderr=subprocess.DEVNULL,
                                       env=self.machine.environment(OTEL_EXPORTER_OTLP_ENDPOINT=receiver.url))
            noted = lambda: dict(self.spool("SELECT name, value FROM forwarder")) if self.spool(
                "SELECT 1 FROM sqlite_schema WHERE name = 'forwarder'") else {}
            wait_for(lambda: noted().get("ordered_until"))
            process.send_signal(signal.SIGTERM)
            process.wait()
        forwarder = self.status()["forwarder"]
        self.assertGreaterEqual(forwarder["ordered_until"] - forwarder["last_error_at"], 600e6)
        self.assertIn("503", forwarder["last_error"])


if __name__ == "__main__":
    harness.main()
