"""A forwarder on a spool of its own: what its tests share."""
import contextlib
import os
import shutil
import sqlite3
import subprocess
import tempfile
import time
import unittest

import harness
from otlp_receiver import uid_of

FORWARDER = os.path.join(harness.BIN, "statora_forwarder")
SPOOL_ID = "0123456789abcdef0123456789abcdef"
SCHEMA = """
PRAGMA auto_vacuum=INCREMENTAL;
PRAGMA journal_mode=WAL;
CREATE TABLE events(id INTEGER PRIMARY KEY AUTOINCREMENT, time INTEGER NOT NULL, name TEXT NOT NULL,
  payload TEXT NOT NULL);
CREATE TABLE meta(key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;
PRAGMA user_version=1;
"""


def make_spool(state):
    path = os.path.join(state, "statora.db")
    with contextlib.closing(sqlite3.connect(path, isolation_level=None)) as database:
        database.executescript(SCHEMA)
        database.execute("INSERT INTO meta VALUES('spool_id', ?), ('limit_bytes', '1073741824'), ('limit_days', '30')",
                         (SPOOL_ID,))
    return path


class ForwarderTest(unittest.TestCase):
    def setUp(self):
        self.state = tempfile.mkdtemp(prefix="tessel-forwarder-")
        self.addCleanup(shutil.rmtree, self.state, ignore_errors=True)
        self.path = make_spool(self.state)
        self.errors = ""

    def add(self, count=1, payload='{"Name":"Open","Number1Value":%d}', name="com.vantor.performance.tessel",
            at=None):
        """Adds rows; %d in the payload counts them."""
        at = int(time.time() * 1e6) if at is None else at
        with sqlite3.connect(self.path) as database:
            for number in range(count):
                text = payload % number if "%d" in payload else payload
                database.execute("INSERT INTO events(time, name, payload) VALUES(?, ?, ?)",
                                 (at + number, name, text))

    def query(self, sql):
        with sqlite3.connect(self.path) as database:
            return database.execute(sql).fetchall()

    def counters(self):
        return dict(self.query("SELECT name, value FROM forwarder"))

    def waiting(self):
        return self.query("SELECT count(*) FROM events")[0][0]

    def environment(self, receiver, **more):
        environment = {"PATH": os.environ["PATH"], "TESSEL_STATE_DIR": self.state, "TESSEL_LOG": "stderr",
                       "TESSEL_FORWARD_RATE": "0", "TESSEL_FORWARD_RETRY": "1", "TESSEL_FORWARD_SPREAD": "0",
                       "TESSEL_FORWARD_INTERVAL": "1"}
        environment.update({name: os.environ[name] for name in os.environ if name.endswith("SAN_OPTIONS")})
        if receiver:
            environment["OTEL_EXPORTER_OTLP_ENDPOINT"] = receiver if isinstance(receiver, str) else receiver.url
        environment.update(more)
        return environment

    def run_forwarder(self, receiver, *arguments, **more):
        result = subprocess.run([FORWARDER, *(arguments or ["--once"])], env=self.environment(receiver, **more),
                                capture_output=True, text=True, timeout=120)
        self.errors = result.stderr
        return result

    def assert_all_arrived_once(self, receiver, count):
        records = receiver.accepted_records()
        self.assertEqual((len(records), len({uid_of(record) for record in records})), (count, count))
        times = [int(record["timeUnixNano"]) for record in records]
        self.assertEqual(times, sorted(times), "oldest first")
        self.assertEqual(self.waiting(), 0)
        self.assertEqual(self.counters()["delivered"], count)
