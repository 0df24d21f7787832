"""Kills of the forwarder and of the receiver while the service writes. A few of them are a test (forwarder_kills_test.py), and
hundreds a trial (bench/delivery_trials.py).

The real service writes, one run after the other, and paces itself to some 80 rows a second. A second writer adds rows as
fast as the trial wants them, so that each kill finds work.
"""
import collections
import contextlib
import hashlib
import json
import multiprocessing
import os
import random
import signal
import socket
import sqlite3
import subprocess
import threading
import time
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

from harness import BIN, Machine, some_points, wait_for
from otlp_receiver import Request, uid_of

BATCH = 512


def serve(port, path):
    """Notes each record before it answers: what was noted has arrived, whatever becomes of the answer."""
    class Handler(BaseHTTPRequestHandler):
        protocol_version = "HTTP/1.1"

        def do_POST(self):
            length = int(self.headers["Content-Length"])
            raw = self.rfile.read(length)
            if len(raw) < length:
                return  # the forwarder was killed
            # A kill in the middle of the write leaves half a line. It stands alone, and shows that it is none by its end.
            lines = "\n" + "".join(f"{uid_of(record)} {hashlib.sha1(json.dumps(record).encode()).hexdigest()} "
                            f"{int(record['timeUnixNano']) // 1000} {record['eventName']} .\n"
                            for record in Request(self.path, self.headers, raw, 0).records)
            file = os.open(path, os.O_WRONLY | os.O_CREAT | os.O_APPEND)
            os.write(file, lines.encode())
            os.close(file)
            self.send_response(200)
            self.send_header("Content-Length", "0")
            self.end_headers()

        def log_message(self, *_):
            pass

    class Server(ThreadingHTTPServer):
        def handle_error(self, *_):
            pass

    Server(("127.0.0.1", port), Handler).serve_forever()


def add_rows(path, stop, at_once):
    database = sqlite3.connect(path, isolation_level=None, timeout=60)
    database.execute("PRAGMA synchronous=OFF")
    number = 0
    while not stop.is_set():
        database.execute("BEGIN IMMEDIATE")
        for number in range(number, number + at_once):
            database.execute("INSERT INTO events(time, name, payload) VALUES(?, 'filler', ?)",
                             (int(time.time() * 1e6), json.dumps({"Row": number})))
        number += 1
        database.execute("COMMIT")
        time.sleep(0.02)


class Trial:
    def __init__(self, at_once):
        self.machine, self.stop = Machine(), multiprocessing.Event()
        self.machine.task()
        self.machine.write_export(some_points(2000))
        self.spool = os.path.join(self.machine.state, "statora.db")
        self.arrived = os.path.join(self.machine.root, "arrived")
        with socket.socket() as probe:
            probe.bind(("127.0.0.1", 0))
            self.port = probe.getsockname()[1]
        self.service = threading.Thread(target=self.report)
        self.service.start()
        wait_for(lambda: self.machine.rows() or not self.service.is_alive(), 300)
        self.writer = multiprocessing.Process(target=add_rows, args=(self.spool, self.stop, at_once), daemon=True)
        self.writer.start()

    def report(self):
        """One run of the service after the other. A stop interrupts the last one, which then stores what it has read."""
        while not self.stop.is_set():
            run = self.machine.start()
            while run.poll() is None and not self.stop.wait(0.02):
                pass
            if run.poll() is None:
                run.send_signal(signal.SIGTERM)
            self.machine.result(run)

    def start(self, what):
        if what == "receiver":
            process = multiprocessing.Process(target=serve, args=(self.port, self.arrived), daemon=True)
            process.start()
            return process
        return subprocess.Popen([os.path.join(BIN, "statora_forwarder")], stderr=subprocess.DEVNULL, env=self.machine.environment(
            OTEL_EXPORTER_OTLP_ENDPOINT=f"http://127.0.0.1:{self.port}", TESSEL_FORWARD_RATE="0", TESSEL_FORWARD_SPREAD="0",
            TESSEL_FORWARD_RETRY="1", TESSEL_FORWARD_INTERVAL="1", TESSEL_LOG_LEVEL=None))

    @staticmethod
    def end(process):
        process.kill()
        process.wait() if isinstance(process, subprocess.Popen) else process.join()

    def query(self, sql):
        with contextlib.closing(sqlite3.connect(self.spool, timeout=60)) as database:
            return database.execute(sql).fetchall()

    def has_arrived(self):
        return os.path.getsize(self.arrived) if os.path.exists(self.arrived) else 0

    def kill(self, victims, after_each=lambda victim: None):
        """Kills one victim after the other, each at a random moment after more has arrived."""
        running = {what: self.start(what) for what in ("receiver", "forwarder")}
        try:
            for victim in victims:
                before = self.has_arrived()
                wait_for(lambda: self.has_arrived() > before, 300)
                time.sleep(random.uniform(0, 0.1))
                self.end(running[victim])
                after_each(victim)
                running[victim] = self.start(victim)
            self.finish_writing()
            wait_for(lambda: self.query("SELECT count(*) FROM events") == [(0,)], 600)
        finally:
            for process in running.values():
                self.end(process)

    def finish_writing(self):
        self.stop.set()
        self.writer.join()
        self.service.join()

    def close(self):
        self.finish_writing()
        self.machine.close()

    def outcome(self):
        """(rows that were ever stored, rows that arrived more than once, what is wrong)."""
        uids, times, copies = collections.defaultdict(set), 0, {}
        with open(self.arrived, encoding="utf-8") as file:
            for line in file:
                if not line.endswith(" .\n"):
                    continue
                uid, digest, at, name, _ = line.split()
                uids[uid].add(digest)
                copies[uid] = (int(at), name)
                times += 1
        rows = self.query("SELECT time, name FROM forwarder_delivered")
        [(stored,)] = self.query("SELECT seq FROM sqlite_sequence WHERE name = 'events'")
        of_service = sum(name != "filler" for _, name in rows)
        facts = {f"{stored} rows were stored, {len(rows)} delivered": stored == len(rows),
                 f"{of_service} rows are of the service": of_service > 0,
                 f"{len(uids)} ids arrived": len(uids) == stored,
                 "an id is the same record each time": all(len(digests) == 1 for digests in uids.values()),
                 "what arrived is what was stored": collections.Counter(copies.values()) == collections.Counter(rows)}
        return stored, times - len(uids), [fact for fact, good in facts.items() if not good]
