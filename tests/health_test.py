#!/usr/bin/env python3
"""What a machine tells about itself: health records of the forwarder."""
import json
import os
import re
import stat

import harness
from faults.fault_machine import FaultMachine
from harness import MachineTest, some_points
from otlp_receiver import Answer, Receiver


class HealthRecords(MachineTest):
    def forward(self, receiver, **extra):
        return self.machine.result(self.machine.start(
            "statora_forwarder", "--once", OTEL_EXPORTER_OTLP_ENDPOINT=receiver.url, TESSEL_FORWARD_RATE="0",
            TESSEL_FORWARD_RETRY="1", **extra))

    def sent(self):
        """The events that have left, in order."""
        return [json.loads(line) for line in self.machine.ctl("events", "--sent", "--json").out.splitlines()]

    def test_a_record_follows_the_rows_of_a_run(self):
        self.machine.write_export(some_points(5))
        self.run_clean()
        rows = len(self.machine.rows())
        with Receiver() as receiver:
            self.assertEqual(self.forward(receiver).status, 0)
            self.assertEqual([one["name"] for one in self.sent()].count("tessel.health"), 0, "off unless asked for")
            self.assertEqual(self.forward(receiver, TESSEL_FORWARD_HEALTH="1").status, 0)
        *others, health = self.sent()
        self.assertEqual((len(others), health["name"], self.machine.rows()), (rows, "tessel.health", []))
        record = self.machine.record()
        told = health["payload"]
        self.assertEqual(json.loads(told["Runs"]), [
            {"start": record["start"], "end": record["end"], "outcome": "completed", "inspected": record["inspected"],
             "sent": rows, "stored": rows, "refused": 0}])
        self.assertTrue(all(record["start"] <= one["time"] <= record["end"] for one in others), "a run's rows have its time")
        self.assertEqual([told[key] for key in ("RowsStored", "RowsDelivered", "RowsWaiting")], [rows, rows, 0])

    def test_an_outage_hides_no_run(self):
        self.machine.write_export(some_points(2))
        clock, away = os.path.join(self.machine.root, "clock"), True
        with Receiver(lambda request, number: Answer(503 if away else 200)) as receiver:
            self.run_clean()
            process = self.machine.start("statora_forwarder", OTEL_EXPORTER_OTLP_ENDPOINT=receiver.url, TESSEL_FORWARD_SPREAD="0",
                                         TESSEL_FORWARD_RETRY="1", TESSEL_FORWARD_INTERVAL="1", TESSEL_FORWARD_HEALTH="1",
                                         **FaultMachine.faults(CLOCK=clock))
            self.addCleanup(process.kill)

            def waiting_runs():
                return [json.loads(dict(payload)["Runs"]) for name, payload in self.machine.rows() if name == "tessel.health"]

            harness.wait_for(lambda: [len(runs) for runs in waiting_runs()] == [1])
            self.run_clean()
            self.run_clean()
            with open(clock, "w", encoding="utf-8") as file:
                file.write("3700")
            harness.wait_for(lambda: [len(runs) for runs in waiting_runs()] == [3])
            away = False
            harness.wait_for(lambda: not self.machine.rows())
            process.terminate()
            self.assertEqual(self.machine.result(process).status, 0)
        *_, told = [one["payload"] for one in self.sent() if one["name"] == "tessel.health"]
        self.assertEqual((len(json.loads(told["Runs"])), told["RunsMissing"]), (3, 0))

    def test_switched_off_a_waiting_record_is_removed(self):
        self.machine.write_export(some_points(1))
        self.run_clean()
        with Receiver(lambda request, number: Answer(401)) as receiver:
            self.forward(receiver, TESSEL_FORWARD_HEALTH="1")
        self.assertEqual(self.machine.rows()[-1][0], "tessel.health")
        with Receiver() as receiver:
            self.assertEqual(self.forward(receiver).status, 0)
        self.assertNotIn("tessel.health", [one["name"] for one in self.sent()])

    def test_a_machine_that_is_not_tasked_tells_its_health(self):
        self.machine.write_export(some_points(1))
        self.machine.task('{"TaskedOn": false}')
        self.run_clean()
        with Receiver() as receiver:
            self.forward(receiver, TESSEL_FORWARD_HEALTH="1")
            self.assertEqual(receiver.requests, [], "there is no spool to deliver from")
            self.assertEqual(self.machine.ctl("status", "--save").status, 0)
            self.forward(receiver, TESSEL_FORWARD_HEALTH="1")
        [health] = self.sent()
        told = health["payload"]
        saved = json.loads(self.saved())
        self.assertEqual((told["TaskedOn"], told["Good"], told["Runs"], told["StatusTime"]),
                         (False, True, "[]", saved["time"]))
        self.machine.task()
        self.run_clean()
        self.assertTrue(self.machine.rows(), "the service takes the spool for its own")

    def saved(self):
        with open(os.path.join(self.machine.state, "status.json"), encoding="utf-8") as file:
            return file.read()


def text_of(name):
    with open(os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", name), encoding="utf-8") as file:
        return file.read()


class SavedStatus(MachineTest):
    def metrics(self, path):
        """Each sample with its labels, and the types of the metrics."""
        with open(path, encoding="utf-8") as file:
            text = file.read()
        types = dict(re.findall(r"(?m)^# TYPE (\S+) (\S+)$", text))
        samples = {name + labels: float(value) for name, labels, value in re.findall(r"(?m)^(\w+)(\{.*\})? (\S+)$", text)}
        self.assertEqual({re.sub(r"\{.*", "", name) for name in samples}, set(types))
        return samples, types

    def test_metrics_tell_what_the_status_tells(self):
        self.machine.write_export(some_points(5))
        path = os.path.join(self.machine.root, "tessel.prom")
        self.assertEqual(self.machine.ctl("status", "--prometheus", path).status, 0)
        self.assertNotIn("tessel_spool_rows_waiting", self.metrics(path)[0], "what is not there has no sample")
        self.run_clean()
        self.machine.task("{")
        result = self.machine.ctl("status", "--prometheus", path, "--json")
        self.assertEqual((result.status, stat.S_IMODE(os.stat(path).st_mode), os.path.exists(path + ".new")), (1, 0o644, False))
        status = json.loads(result.out)
        samples, types = self.metrics(path)
        record = self.machine.record()
        self.assertEqual({name: value for name, value in samples.items() if name.startswith("tessel_problem")},
                         {f'tessel_problem{{code="{code}"}}': code == "tasking_unreadable" for code in status["checked"]})
        expected = {"tessel_good": 0, "tessel_tasked": 0, 'tessel_last_run_outcome{outcome="completed"}': 1,
                    'tessel_last_run_outcome{outcome="failed"}': 0, "tessel_last_run_rows_stored": record["rows_stored"],
                    "tessel_last_run_rows_sent": record["rows_stored"], "tessel_spool_rows_waiting": record["rows_stored"],
                    'tessel_last_run_objects{verdict="reported"}': record["classified"][1],
                    'tessel_rows_refused_total{reason="limit"}': 0, "tessel_rows_expired_total": 0,
                    "tessel_last_run_end_timestamp_seconds": record["end"] / 1e6,
                    "tessel_status_timestamp_seconds": status["time"] / 1e6}
        self.assertEqual({name: samples.get(name) for name in expected}, expected)
        self.assertTrue(all((kind == "counter") == name.endswith("_total") for name, kind in types.items()))

    def test_only_the_owner_of_the_state_saves(self):
        harness.require_root()
        os.chown(self.machine.state, 65534, 65534)
        result = self.machine.ctl("status", "--save")
        self.assertEqual((result.status, os.listdir(self.machine.state)), (4, []))
        self.assertRegex(result.errors, "belongs to user 65534")

    def test_the_fleet_example_knows_every_metric_it_names(self):
        path = os.path.join(self.machine.root, "tessel.prom")
        self.machine.machine_id = "0123456789abcdef0123456789abcdef"
        self.assertEqual(self.machine.ctl("tasking", "on", "--share", "100%").status, 0)
        self.machine.write_export(some_points(1))
        self.run_clean()
        with Receiver() as receiver:
            self.machine.result(self.machine.start("statora_forwarder", "--once", OTEL_EXPORTER_OTLP_ENDPOINT=receiver.url))
        self.run_clean()
        self.machine.ctl("status", "--prometheus", path)
        known = set(self.metrics(path)[1])
        for name in ("examples/fleet/alerts.yml", "examples/fleet/alerts_test.yml", "examples/fleet/dashboard.json"):
            named = set(re.findall(r"tessel_(?!reporter)\w+", text_of(name)))
            self.assertTrue(named)
            self.assertEqual(named - known, set(), name)


if __name__ == "__main__":
    harness.main()
