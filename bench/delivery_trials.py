#!/usr/bin/env python3
"""Long trials of the delivery: kills while the service writes, and a slow line.

  TESSEL_BIN=build/release/bin bench/delivery_trials.py [--kills 200] [--seconds 60]

Kills the forwarder and then the receiver, so often each, while the real service writes, and a second writer faster than
it. Every row must arrive, under one id, and a kill may repeat one batch at most. Then a line of 40 kB/s, without
compression and without a rate limit, must carry at least 90 % of what it can. Exit status 1 if one of these fails.
"""
import argparse
import json
import os
import shutil
import socket
import sqlite3
import subprocess
import sys
import tempfile
import threading
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "..", "tests"))
from delivery_kills import BATCH, Trial  # noqa: E402
from forwarder_case import FORWARDER, make_spool  # noqa: E402


def environment(state, port):
    return {"TESSEL_STATE_DIR": state, "TESSEL_FORWARD_RATE": "0", "TESSEL_FORWARD_SPREAD": "0", "TESSEL_FORWARD_RETRY": "1",
            "TESSEL_FORWARD_INTERVAL": "1", "TESSEL_LOG": "stderr", "OTEL_EXPORTER_OTLP_ENDPOINT": f"http://127.0.0.1:{port}"}


def trial_of_kills(victim, kills):
    trial = Trial(at_once=100)
    try:
        trial.kill([victim] * kills)
        stored, repeated, wrong = trial.outcome()
    finally:
        trial.close()
    if repeated > kills * BATCH:
        wrong.append("too many repeats")
    print(f"{kills} kills of the {victim}: {stored} rows of the service and a second writer, {repeated} repeated "
          f"({repeated / kills:.0f} a kill): {', '.join(wrong) or 'good'}", flush=True)
    return not wrong


def trial_of_a_line(seconds, speed=40_000):
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
    process = subprocess.Popen([FORWARDER], env=settings, stderr=subprocess.DEVNULL)
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
    parser.add_argument("--kills", type=int, default=200)
    parser.add_argument("--seconds", type=int, default=60)
    arguments = parser.parse_args()
    results = [trial_of_kills(victim, arguments.kills) for victim in ("forwarder", "receiver")]
    results.append(trial_of_a_line(arguments.seconds))
    return 0 if all(results) else 1


if __name__ == "__main__":
    sys.exit(main())
