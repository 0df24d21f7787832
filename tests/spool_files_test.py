#!/usr/bin/env python3
"""The spool's files and schema in the hands of a stranger: neither the service nor a reader may hang, obey or be held up."""
import contextlib
import os
import shutil
import socket
import sqlite3
import subprocess
import time

import harness
from harness import BIN, MachineTest, some_points, wait_for

PROGRAMS = [("tessel_reporter",), ("tesselctl", "events"), ("tesselctl", "status"), ("statora_forwarder", "--dry-run")]


class SpoolTest(MachineTest):
    def setUp(self):
        super().setUp()
        self.machine.write_export(some_points(2))
        self.run_clean()
        self.spool = os.path.join(self.machine.state, "statora.db")
        self.rows = len(self.machine.rows())

    def answer(self, *command, **extra):
        result = self.machine.result(self.machine.start(*command, **extra), timeout=30)
        return result.status, result.out + result.errors

    @contextlib.contextmanager
    def database(self):
        with contextlib.closing(sqlite3.connect(self.spool, isolation_level=None)) as database:
            yield database


class Names(SpoolTest):
    def put_socket(self, path):
        with socket.socket(socket.AF_UNIX) as server:
            server.bind(path)

    def test_what_is_no_regular_file_is_refused(self):
        kinds = {"a named pipe": os.mkfifo, "a link": lambda path: os.symlink(self.spool + ".kept", path),
                 "a directory": os.mkdir, "a socket": self.put_socket}
        for suffix, words in [("", kind) for kind in kinds] + [(end, "a named pipe") for end in ("-wal", "-shm", "-journal")]:
            with self.subTest(name="statora.db" + suffix, kind=words):
                path = self.spool + suffix
                if not suffix:
                    os.rename(path, path + ".kept")
                kinds[words](path)
                for command in PROGRAMS:
                    status, said = self.answer(*command)
                    self.assertEqual(status, {"tessel_reporter": 0, "statora_forwarder": 66}.get(command[0], 1), said)
                    self.assertIn(f"{path} is {words} and not a regular file", " ".join(said.split()))
                shutil.rmtree(path) if words == "a directory" else os.unlink(path)
                if not suffix:
                    os.rename(path + ".kept", path)
        self.run_clean()
        self.assertEqual(len(self.machine.rows()), 2 * self.rows, "and nothing was lost that stood there before")

    def test_a_directory_that_is_a_link_is_followed(self):
        elsewhere = self.machine.state + ".elsewhere"
        os.rename(self.machine.state, elsewhere)
        os.symlink(elsewhere, self.machine.state)
        self.run_clean()
        self.assertEqual(len(self.machine.rows()), 2 * self.rows)

    def test_a_strangers_file_is_refused(self):
        harness.require_root()
        os.chown(self.spool, 4711, -1)
        for command in PROGRAMS:
            self.assertIn(f"{self.spool} belongs to user 4711", " ".join(self.answer(*command)[1].split()))
        os.chown(self.spool, 0, -1)
        log = self.spool + "-wal"
        for mode, group, rows in ((0o2770, 4712, 1), (0o750, 4712, 0), (0o2770, 4713, 0)):
            open(log, "wb").close()
            os.chown(log, 4711, 4712)
            os.chown(self.machine.state, 0, group)
            os.chmod(self.machine.state, mode)
            before = len(self.machine.rows())
            open(log, "ab").close()
            os.chown(log, 4711, 4712)
            self.run_clean()
            self.assertEqual(len(self.machine.rows()) - before, rows * self.rows, (mode, group))


class Schema(SpoolTest):
    def test_a_trigger_neither_runs_nor_stops_sends(self):
        with self.database() as database:
            database.executescript("""
                CREATE TABLE stolen(payload);
                CREATE TRIGGER copy AFTER INSERT ON events BEGIN INSERT INTO stolen VALUES(new.payload); END;
                CREATE TRIGGER stop BEFORE INSERT ON events BEGIN SELECT raise(ABORT, 'no'); END;
                CREATE TRIGGER keep BEFORE DELETE ON events BEGIN SELECT raise(IGNORE); END;""")
        self.run_clean()
        self.assertEqual(len(self.machine.rows()), 2 * self.rows)
        with self.database() as database:
            self.assertEqual(database.execute("SELECT count(*) FROM stolen").fetchone(), (0,))

    def test_tables_of_another_shape_are_set_aside(self):
        for tampering in ("ALTER TABLE events ADD COLUMN more TEXT CHECK (id < 9)",
                          "CREATE UNIQUE INDEX one ON events((id < 0)) WHERE id > 8",
                          "CREATE INDEX slow ON events(length(zeroblob(id * 1000000)))",
                          "ALTER TABLE events RENAME TO kept; CREATE VIEW events AS SELECT * FROM kept",
                          "DROP TABLE events", "DELETE FROM meta", "DROP TABLE meta",
                          "UPDATE sqlite_sequence SET seq = 9223372036854775807",
                          "PRAGMA writable_schema=ON; UPDATE sqlite_schema SET sql='CREATE TABLE events(' WHERE name='events'"):
            with self.subTest(tampering):
                with self.database() as database:
                    database.executescript(tampering)
                self.run_clean()
                self.assertEqual(len(self.machine.rows()), self.rows)
                aside = [name for name in os.listdir(self.machine.state) if name.startswith("statora.db.damaged")]
                self.assertEqual(len([name for name in aside if name.endswith("Z")]), 1)
                self.assertEqual(self.machine.ctl("status").status, 0)
                for name in aside:
                    os.unlink(os.path.join(self.machine.state, name))

    def test_the_log_is_turned_on_again(self):
        with self.database() as database:
            database.execute("PRAGMA journal_mode=DELETE")
        self.run_clean()
        with self.database() as database:
            self.assertEqual(database.execute("PRAGMA journal_mode").fetchone(), ("wal",))


class Readers(SpoolTest):
    def test_a_pager_that_is_left_open_holds_nothing(self):
        with self.database() as database:
            database.executemany("INSERT INTO events(time, name, payload) VALUES(?, 'a', ?)",
                                 [(number, '{"Text":"' + "x" * 2000 + '"}') for number in range(3000)])
        reader = subprocess.Popen([os.path.join(BIN, "tesselctl"), "events", "--json"], stdout=subprocess.PIPE,
                                  env=self.machine.environment())
        self.addCleanup(reader.wait)
        self.addCleanup(reader.stdout.close)
        reader.stdout.read(1)
        time.sleep(0.5)  # by now the pipe is full, and the reader waits for us in the middle of its rows
        with self.database() as database:
            database.execute("INSERT INTO events(time, name, payload) VALUES(1, 'last', '{}')")
            self.assertEqual(database.execute("PRAGMA wal_checkpoint(TRUNCATE)").fetchone(), (0, 0, 0))
        shown = reader.stdout.read().splitlines()
        self.assertEqual(len(shown), self.rows + 3001, "a row that came meanwhile is shown, too")

    def test_following_a_spool_that_gets_damaged_ends(self):
        follower = self.machine.start("tesselctl", "events", "--follow")
        wait_for(lambda: os.fstat(follower.tessel_output.fileno()).st_size > 0)
        with open(self.spool + ".new", "wb") as file:
            file.write(os.urandom(8192))
        os.rename(self.spool + ".new", self.spool)
        result = self.machine.result(follower, timeout=30)
        self.assertEqual(result.status, 1)
        self.assertIn("the spool is damaged: " + self.spool, result.errors)


if __name__ == "__main__":
    harness.main()
