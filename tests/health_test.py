#!/usr/bin/env python3
"""What a machine tells about itself: health records of the forwarder."""
import json

import harness
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

    def test_switched_off_a_waiting_record_is_removed(self):
        self.machine.write_export(some_points(1))
        self.run_clean()
        with Receiver(lambda request, number: Answer(401)) as receiver:
            self.forward(receiver, TESSEL_FORWARD_HEALTH="1")
        self.assertEqual(self.machine.rows()[-1][0], "tessel.health")
        with Receiver() as receiver:
            self.assertEqual(self.forward(receiver).status, 0)
        self.assertNotIn("tessel.health", [one["name"] for one in self.sent()])


if __name__ == "__main__":
    harness.main()
