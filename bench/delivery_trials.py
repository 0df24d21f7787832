#!/usr/bin/env python3
"""Long trials of the delivery: kills while the service writes, and a slow line.

  bench/delivery_trials.py [--bin build/release/bin] [--kills 200] [--seconds 60]

Kills the forwarder and then the receiver, so often each. Every row must arrive, under one id, and a
kill may repeat one batch at most. Then a line of 40 kB/s, without compression and without a rate limit, must
carry at least 90 % of what it can. Exit status 1 if one of these fails.
"""
import argparse
import collections
import json
import multiprocessing
import os
import random
import shutil
import socket
import sqlite3
import subprocess
import sys
import tempfile
import threading
import time
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "..", "tests"))
from forwarder_case import make_spool  # noqa: E402
from otlp_receiver import Request, uid_of  # noqa: E402

BATCH = 512


def payload_of(record):
    return next(a["value"]["stringValue"] for a in record["attributes"] if a["key"] == "Row")


def serve(port, path):
    """Notes each record before it answers: what was noted has arrived, whatever the answer meets."""
    class Handler(BaseHTTPRequestHandler):
        protocol_version = "HTTP/1.1"

        def do_POST(self):
            length = int(self.headers["Content-Length"])
            raw = self.rfile.read(length)
            if len(raw) == length:
                lines = "".join(f"{uid_of(record)} {payload_of(record)}\n" for record in Request(self.path, self.headers, raw, 0).records)
                with open(path, "a", encoding="utf-8") as file:
                    file.write(lines)
                self.send_response(200)
                self.send_header("Content-Length", "0")
                self.end_headers()

        def log_message(self, *_):
            pass

    class Server(ThreadingHTTPServer):
        def handle_error(self, *_):
            pass  # a forwarder that was killed

    Server(("127.0.0.1", port), Handler).serve_forever()


def free_port():
    with socket.socket() as probe:
        probe.bind(("127.0.0.1", 0))
        return probe.getsockname()[1]


def write_rows(path, stop, written):
    """As the service does: a few rows at a time, all the time."""
    database = sqlite3.connect(path, isolation_level=None, timeout=60)
    database.execute("PRAGMA synchronous=OFF")
    while not stop.is_set():
        database.execute("BEGIN IMMEDIATE")
        for _ in range(200):
            database.execute("INSERT INTO events(time, name, payload) VALUES(?, 'a', ?)",
                             (int(time.time() * 1e6), json.dumps({"Row": str(written.value)})))
            written.value += 1
        database.execute("COMMIT")
        time.sleep(0.02)


def environment(state, port):
    return {"TESSEL_STATE_DIR": state, "TESSEL_FORWARD_RATE": "0", "TESSEL_FORWARD_SPREAD": "0", "TESSEL_FORWARD_RETRY": "1",
            "TESSEL_FORWARD_INTERVAL": "1", "TESSEL_LOG": "stderr", "OTEL_EXPORTER_OTLP_ENDPOINT": f"http://127.0.0.1:{port}"}


def trial_of_kills(forwarder, victim, kills):
    state = tempfile.mkdtemp(prefix="tessel-trial-")
    path, arrived, port = make_spool(state), os.path.join(state, "arrived"), free_port()
    stop, written = multiprocessing.Event(), multiprocessing.Value("q", 0)

    def start(what):
        if what == "forwarder":
            return subprocess.Popen([forwarder], env=environment(state, port), stderr=subprocess.DEVNULL)
        process = multiprocessing.Process(target=serve, args=(port, arrived), daemon=True)
        process.start()
        return process

    def end(process):
        process.kill()
        process.wait() if isinstance(process, subprocess.Popen) else process.join()

    writer = multiprocessing.Process(target=write_rows, args=(path, stop, written))
    writer.start()
    running = {what: start(what) for what in ("receiver", "forwarder")}
    chooser = random.Random()
    for _ in range(kills):
        time.sleep(chooser.uniform(0.02, 0.4))
        end(running[victim])
        running[victim] = start(victim)
    stop.set()
    writer.join()

    def waiting():
        with sqlite3.connect(path, timeout=60) as database:
            return database.execute("SELECT count(*) FROM events").fetchone()[0]

    deadline = time.monotonic() + 600
    while waiting() and time.monotonic() < deadline:
        time.sleep(0.5)
    for process in running.values():
        end(process)
    ids, times = collections.defaultdict(set), 0
    with open(arrived, encoding="utf-8") as file:
        for line in file:
            uid, row = line.split()
            ids[row].add(uid)
            times += 1
    shutil.rmtree(state)
    repeated = times - len(ids)
    good = (len(ids) == written.value and all(len(of_row) == 1 for of_row in ids.values())
            and len({uid for of_row in ids.values() for uid in of_row}) == len(ids) and repeated <= kills * BATCH)
    print(f"{kills} kills of the {victim}: {written.value} rows written, {len(ids)} arrived, {repeated} repeated "
          f"({repeated / kills:.0f} a kill): {'good' if good else 'BAD'}", flush=True)
    return good


def trial_of_a_line(forwarder, seconds, speed=40_000):
    state = tempfile.mkdtemp(prefix="tessel-trial-")
    path = make_spool(state)
    with sqlite3.connect(path) as database:
        text = json.dumps({f"Key{number}": "x" * 40 for number in range(12)})
        database.executemany("INSERT INTO events(time, name, payload) VALUES(1, 'a', ?)", [(text,)] * 20_000)
    listener = socket.socket()
    listener.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 8192)
    listener.bind(("127.0.0.1", 0))
    listener.listen()
    received, began = [0], []

    def receive(connection):
        """Reads as fast as the line carries, and answers each request."""
        pending = b""
        while True:
            began or began.append(time.monotonic())
            ahead = received[0] / speed - (time.monotonic() - began[0])
            if ahead > 0:
                time.sleep(ahead)
            chunk = connection.recv(2000)
            if not chunk:
                return
            received[0] += len(chunk)
            pending += chunk
            head, found, body = pending.partition(b"\r\n\r\n")
            length = int(head.lower().partition(b"content-length:")[2].split(b"\r\n")[0]) if found else 0
            if found and len(body) >= length:
                pending = body[length:]
                connection.sendall(b"HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n")

    def accept():
        while True:
            try:
                connection, _ = listener.accept()
            except OSError:
                return
            threading.Thread(target=receive, args=(connection,), daemon=True).start()

    threading.Thread(target=accept, daemon=True).start()
    settings = environment(state, listener.getsockname()[1]) | {"OTEL_EXPORTER_OTLP_COMPRESSION": "none"}
    process = subprocess.Popen([forwarder], env=settings, stderr=subprocess.DEVNULL)
    time.sleep(seconds)
    used = received[0] / speed / (time.monotonic() - began[0])
    process.kill()
    process.wait()
    listener.close()
    with sqlite3.connect(path, timeout=60) as database:
        left, delivered = (database.execute(f"SELECT count(*) FROM {table}").fetchone()[0] for table in ("events", "forwarder_delivered"))
    shutil.rmtree(state)
    good = used >= 0.9 and delivered > 0
    print(f"a line of {speed // 1000} kB/s: {used:.0%} used in {seconds} s, {delivered} rows acknowledged, {left} wait: "
          f"{'good' if good else 'BAD'}", flush=True)
    return good


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--bin", default=os.path.join(HERE, "../build/release/bin"))
    parser.add_argument("--kills", type=int, default=200)
    parser.add_argument("--seconds", type=int, default=60)
    arguments = parser.parse_args()
    forwarder = os.path.join(arguments.bin, "statora_forwarder")
    results = [trial_of_kills(forwarder, victim, arguments.kills) for victim in ("forwarder", "receiver")]
    results.append(trial_of_a_line(forwarder, arguments.seconds))
    return 0 if all(results) else 1


if __name__ == "__main__":
    sys.exit(main())
