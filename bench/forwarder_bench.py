#!/usr/bin/env python3
"""How fast the forwarder empties a spool, at what cost, and how long the service waits for it.

  bench/forwarder_bench.py [--bin build/release/bin] [--events 100000] [--rounds 5]

The receiver is a process of its own, on the machine's other core; the forwarder is kept on one. The
rate limit is off. In one more round a second process adds events, as the service does, and notes
how long each took.
"""
import argparse
import json
import multiprocessing
import os
import random
import resource
import shutil
import socketserver
import sqlite3
import statistics
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "..", "tests"))
from forwarder_case import make_spool  # noqa: E402

def some_payload(random):
    """An event as the service spools them: few subsystems and names, numbers that all differ."""
    app = random.choice(("Calendar", "Mail", "Maps", "Notes", "Clock", "Player", "Files", "Settings"))
    return json.dumps({
        "Subsystem": f"com.vantor.{app}", "Category": random.choice(("View", "Launch", "Scroll", "Sync")),
        "Name": random.choice(("Open", "Close", "Refresh", "Search", "Import", "Save")) + random.choice(("", "All", "One")),
        "String1Name": "period", "String1Value": random.choice(("day", "week", "month")),
        "Number1Name": "entries", "Number1Value": random.randrange(100_000), "IntervalType": "Interval",
        "DurationInSeconds": float(f"{random.expovariate(2):.8g}"), "StartProcessName": f"com.vantor.{app}",
        "EndProcessName": f"com.vantor.{app}", "BootPartitionFS": "ext4", "BootDiskType": "SSD",
    }, separators=(",", ":"))


class Handler(socketserver.StreamRequestHandler):
    """As little of HTTP as the forwarder needs, so that the receiver is not what is measured."""
    disable_nagle_algorithm = True

    def handle(self):
        while True:
            length = 0
            line = self.rfile.readline()
            if not line:
                return
            while line not in (b"\r\n", b""):
                name, _, value = line.partition(b":")
                if name.lower() == b"content-length":
                    length = int(value)
                line = self.rfile.readline()
            self.server.bytes.value += len(self.rfile.read(length))
            self.server.requests.value += 1
            self.server.last.value = time.monotonic()
            self.wfile.write(b"HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\n{}")


def serve(port, total, requests, last):
    with socketserver.ThreadingTCPServer(("127.0.0.1", 0), Handler) as server:
        server.daemon_threads = True
        server.bytes, server.requests, server.last = total, requests, last
        port.value = server.server_address[1]
        server.serve_forever()


def write_events(path, stop, waits):
    database = sqlite3.connect(path, isolation_level=None, timeout=10)
    database.execute("PRAGMA synchronous=OFF")  # the disk is not what is measured
    payload = some_payload(random.Random())
    while not stop.is_set():
        start = time.perf_counter()
        database.execute("INSERT INTO events(time, name, payload) VALUES(1, 'late', ?)", (payload,))
        waits.append(time.perf_counter() - start)
        time.sleep(0.0125)


def fill(path, events):
    chooser = random.Random(1)

    def rows():
        at = int(time.time() * 1e6) - 3_600_000_000
        for number in range(events):
            if number % 2 == 0:  # each object is sent twice
                payload = some_payload(chooser)
                named = json.loads(payload)
                names = ("com.vantor.performance.tessel",
                         f"ts__{named['Subsystem']}__{named['Category']}__{named['Name']}")
            at += chooser.randrange(25_000)
            yield at, names[number % 2], payload

    with sqlite3.connect(path) as database:
        database.executemany("INSERT INTO events(time, name, payload) VALUES(?, ?, ?)", rows())


def deliver(forwarder, state, port, gzip, last):
    environment = {"TESSEL_STATE_DIR": state, "TESSEL_FORWARD_RATE": "0", "TESSEL_LOG": "stderr",
                   "OTEL_EXPORTER_OTLP_ENDPOINT": f"http://127.0.0.1:{port}",
                   "OTEL_EXPORTER_OTLP_COMPRESSION": "gzip" if gzip else "none"}
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    start = time.monotonic()
    subprocess.run([forwarder, "--once"], env=environment, check=True,
                   preexec_fn=lambda: os.sched_setaffinity(0, {0}))
    wall = last.value - start
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    return wall, after.ru_utime + after.ru_stime - before.ru_utime - before.ru_stime, after.ru_maxrss


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--bin", default=os.path.join(HERE, "../build/release/bin"))
    parser.add_argument("--events", type=int, default=100_000)
    parser.add_argument("--rounds", type=int, default=5)
    arguments = parser.parse_args()
    forwarder = os.path.join(arguments.bin, "statora_forwarder")
    port, total, requests = (multiprocessing.Value("q", 0) for _ in range(3))
    last = multiprocessing.Value("d", 0)  # when the last request had arrived
    server = multiprocessing.Process(target=serve, args=(port, total, requests, last), daemon=True)
    server.start()
    while not port.value:
        time.sleep(0.01)
    os.sched_setaffinity(server.pid, {os.cpu_count() - 1})
    state = tempfile.mkdtemp(prefix="tessel-bench-")
    path = make_spool(state)
    peak = 0
    for gzip in (True, False):
        walls, processors = [], []
        total.value = requests.value = 0
        for _ in range(arguments.rounds):
            fill(path, arguments.events)
            wall, processor, peak = deliver(forwarder, state, port.value, gzip, last)
            walls.append(wall)
            processors.append(processor)
        sent = arguments.events * arguments.rounds
        print(f"{'gzip' if gzip else 'plain'}: {arguments.events / statistics.median(walls):,.0f} records a second "
              f"(slowest round {arguments.events / max(walls):,.0f}), "
              f"{statistics.median(processors) / arguments.events * 1e6:.1f} us of processor time a record, "
              f"{total.value / sent:.0f} bytes a record, {total.value / requests.value:,.0f} bytes a request")
    print(f"peak memory {peak / 1024:.1f} MiB")

    fill(path, arguments.events)
    with multiprocessing.Manager() as manager:
        waits, stop = manager.list(), multiprocessing.Event()
        writer = multiprocessing.Process(target=write_events, args=(path, stop, waits))
        writer.start()
        deliver(forwarder, state, port.value, True, last)
        stop.set()
        writer.join()
        ordered = sorted(waits)
        print(f"a send while it delivers: median {statistics.median(ordered) * 1e3:.2f} ms, "
              f"99 % within {ordered[len(ordered) * 99 // 100] * 1e3:.2f} ms, "
              f"longest of {len(ordered)} {ordered[-1] * 1e3:.1f} ms")
    shutil.rmtree(state)


if __name__ == "__main__":
    main()
