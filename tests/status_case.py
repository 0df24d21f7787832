"""Shared by the tests of `tesselctl status`: a machine whose problems are asked for, and a service manager to ask."""
import contextlib
import json
import os
import socket
import sqlite3
import struct
import subprocess
import threading
import time

import harness
from harness import BIN, MachineTest, log_event, some_points
from otlp_receiver import Receiver

DAY = 86400
STRANGER = 54321
NOBODY = ("/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups")
# A machine that is up for four days, whatever the one is that runs this.
UP_FOR_DAYS = ("/usr/bin/unshare", "--time", "--boottime", str(4 * DAY), "--fork")


def up_for(seconds):
    boottime = str(int(seconds - time.clock_gettime(time.CLOCK_BOOTTIME)))
    return (*UP_FOR_DAYS[:3], boottime, UP_FOR_DAYS[-1])


CODES = ["no_access", "tasking_unreadable", "record_unwritable", "marker_stuck", "deferred", "store_unreadable",
         "store_damaged", "spool_damaged", "forwarder_stuck", "spool_filling", "run_failed", "bailed_out",
         "rows_refused", "rows_expired", "books_unbalanced", "no_completed_run"]


class StatusTest(MachineTest):
    before = ()

    def setUp(self):
        harness.require_root()
        super().setUp()
        self.machine.write_export([log_event("old", at=-90000)] + some_points(2))

    def state(self, name=""):
        return os.path.join(self.machine.state, name)

    def spool(self, statement, *values):
        with contextlib.closing(sqlite3.connect(self.state("statora.db"))) as database, database:
            return database.execute(statement, values).fetchall()

    def fill_spool(self, share=1.0):
        """With rows of a page each, as a share of the least limit."""
        row = (int(time.time() * 1e6), json.dumps({"x": "x" * 3900}))
        with contextlib.closing(sqlite3.connect(self.state("statora.db"))) as database, database:
            database.executemany("INSERT INTO events(time, name, payload) VALUES(?, 'x', ?)", [row] * int(share * 1000))

    def call(self, program, *arguments, before=None, **extra):
        first, *more = [*(self.before if before is None else before), os.path.join(BIN, program), *arguments]
        return self.machine.result(self.machine.start(first, *more, **extra))

    def status(self, **extra):
        result = self.call("tesselctl", "status", "--json", **extra)
        status = json.loads(result.out)
        self.assertEqual((status["good"], result.status), (not status["problems"], 1 if status["problems"] else 0))
        for found in status["problems"] + status["notes"]:
            self.assertTrue(found["words"] and found["advice"] and found["command"], found)
            self.assertLessEqual(found["since"], time.time() * 1e6)
        return status

    def problems(self, **extra):
        """Code to the code that it follows from, or None; each code once, each of those that are looked for."""
        status = self.status(**extra)
        self.assertEqual(status["checked"], CODES)
        self.assertLessEqual({found["code"] for found in status["problems"]}, set(CODES))
        return {found["code"]: found.get("because") for found in status["problems"]}

    def problem(self, code, **extra):
        return next(found for found in self.status(**extra)["problems"] if found["code"] == code)

    def service(self, **extra):
        return self.assert_clean(self.call("tessel_reporter", **extra))

    def change_record(self, change):
        with open(self.state("last_run.json"), encoding="utf-8") as file:
            record = json.load(file)
        change(record)
        with open(self.state("last_run.json"), "w", encoding="utf-8") as file:
            json.dump(record, file)

    def shift_runs(self, days, *also):
        """What a machine shows whose last runs were so many days ago."""
        def change(record):
            for entry in [record] + record["runs"]:
                for key in ("start", "end", *also):
                    if key in entry:
                        entry[key] += int(days * DAY * 1e6)
        self.change_record(change)

    def age(self, path, days):
        os.utime(path, (time.time() - days * DAY,) * 2)

    def tasking_file(self):
        return os.path.join(self.machine.config, harness.TASKING)

    def forward(self, answer, **extra):
        with Receiver(lambda request, number: answer) as receiver:
            environment = self.machine.environment(OTEL_EXPORTER_OTLP_ENDPOINT=receiver.url, TESSEL_FORWARD_RATE="0",
                                                   **extra)
            subprocess.run([os.path.join(BIN, "statora_forwarder"), "--once"], env=environment, capture_output=True,
                           check=False, timeout=60)


class Bus:
    """A service manager on the system bus: tells when each timer elapses, and answers one program."""

    def __init__(self, path, elapses):
        self.path, self.elapses = path, elapses
        self.asked = None
        self._server = socket.socket(socket.AF_UNIX)
        self._server.bind(path)
        self._server.listen()
        threading.Thread(target=self._serve, daemon=True).start()

    def _serve(self):
        peer, _ = self._server.accept()
        with peer, peer.makefile("rb") as lines:
            for line in lines:
                line = line.strip(b"\0\r\n")
                if line.startswith(b"BEGIN"):
                    break
                peer.sendall({b"AUTH": b"DATA\r\n", b"DATA": b"OK " + b"0" * 32 + b"\r\n",
                              b"NEGO": b"AGREE_UNIX_FD\r\n"}[line[:4]])
            for serial in range(1, 3):
                head = lines.read(16)
                body, number, fields = struct.unpack("<4xIII", head)
                request = lines.read((fields + 7) // 8 * 8 + body)
                if serial == 1:  # Hello
                    peer.sendall(self._reply(number, b"s\0", struct.pack("<I", 4) + b":1.1\0"))
                else:
                    self.asked = request
                    peer.sendall(self._reply(number, b"v\0", b"\1t\0" + bytes(5) + struct.pack("<Q", self.elapses)))
            lines.read()

    @staticmethod
    def _reply(to, signature, body):
        fields = b"\x05\1u\0" + struct.pack("<I", to)
        fields += b"\x08\1g\0" + bytes([len(signature) - 1]) + signature
        head = b"l\2\1\1" + struct.pack("<III", len(body), to, len(fields)) + fields
        return head + bytes(-len(head) % 8) + body
