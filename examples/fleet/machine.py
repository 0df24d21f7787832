"""A simulated machine: the real service and the real forwarder, with directories and a machine id of their own."""
import json
import os
import random
import signal
import sqlite3
import subprocess
import time

VERSIONS = ("11", "12", "13")
TASKING = "com.vantor.performance.tessel_reporter_tasking.json"
BOOT = "5f2b1c0d9e8a47b6a1d2c3e4f5061728"
# Where a machine has its own: the directory of the run marker, and the machine id from which identifiers are made.
ENTER = 'mount -n --bind "$1/var_tmp" /var/tmp && mount -n --bind "$1/machine-id" /etc/machine-id && shift && exec "$@"'


def trace_point(number, at, **fields):
    """An entry of the journal in its export format. `at` is in seconds since 1970."""
    micros = int(at * 1e6)
    lines = {"__CURSOR": f"s={'ab' * 16};i={number:x};b={BOOT};m={number:x};t={micros:x};x={number:x}",
             "__REALTIME_TIMESTAMP": micros, "__MONOTONIC_TIMESTAMP": 10**12 + number, "_BOOT_ID": BOOT,
             "MESSAGE": "tessel", "TESSEL_KIND": "event", "TESSEL_TELEMETRY": "1",
             "_EXE": "/opt/Clock.AppDir/usr/bin/Clock", "_COMM": "Clock", "_PID": "4711"}
    lines.update({"TESSEL_" + key.upper(): value for key, value in fields.items()})
    return "".join(f"{key}={value}\n" for key, value in lines.items()) + "\n"


class Machine:
    def __init__(self, fleet, number, programs, faketime):
        self.number, self.root, self.programs, self.faketime = number, os.path.join(fleet, f"machine-{number}"), programs, faketime
        self.killed_services = self.killed_forwarders = 0
        self.chance = random.Random(number)  # the same fleet each time
        for name in ("store", "state", "config", "var_tmp"):
            os.makedirs(os.path.join(self.root, name))
        self.version = VERSIONS[number % len(VERSIONS)]
        for name, text in (("machine-id", f"{self.chance.getrandbits(128):032x}\n"),
                           ("os-release", f'NAME="Debian GNU/Linux"\nVERSION_ID="{self.version}"\n'),
                           (f"config/{TASKING}", '{"TaskedOn": true}')):
            with open(os.path.join(self.root, name), "w", encoding="utf-8") as file:
                file.write(text)
        self.spool = os.path.join(self.root, "state", "statora.db")

    def start(self, program, *arguments, days_ago=0, **environment):
        """A program on this machine, whose clock shows a day that is past."""
        environment = {"PATH": os.environ["PATH"], "LANG": "C.UTF-8", "TESSEL_LOG": "stderr", "TESSEL_DEFER_ON": "file",
                       "TESSEL_TRACE_STORE": self.root + "/store", "TESSEL_STATE_DIR": self.root + "/state",
                       "TESSEL_CONFIG_DIR": self.root + "/config", "TESSEL_OS_RELEASE": self.root + "/os-release", **environment}
        command = ["unshare", "--mount", "--", "sh", "-c", ENTER, "sh", self.root]
        if days_ago:
            # Only the date: clocks that measure waits stay as they are.
            command += ["env", f"LD_PRELOAD={self.faketime}", f"FAKETIME=-{days_ago}d", "FAKETIME_DONT_FAKE_MONOTONIC=1",
                        "FAKETIME_DISABLE_SHM=1"]
        with open(os.path.join(self.root, "log"), "ab") as log:
            return subprocess.Popen([*command, os.path.join(self.programs, program), *arguments], env=environment,
                                    stdin=subprocess.DEVNULL, stdout=log, stderr=log)

    def record_day(self, days_ago):
        """What the applications of this machine recorded in the day before."""
        end = time.time() - days_ago * 86400 - 60
        points = []
        for _ in range(self.chance.randint(15, 40)):
            kind = self.chance.random()
            if kind < 0.5 and self.number % 4:  # a quarter of the machines has no calendar
                point = dict(subsystem="com.vantor.Calendar", category="View", name="Open", string1_name="period",
                             duration=f"{self.chance.uniform(0.01, 2):.4f}",
                             string1_value=self.chance.choice(["week", "day", "month", "fortnight"]))
            elif kind < 0.8:
                point = dict(subsystem="com.vantor.Mail", category="Fetch", name="Sizes", number1_name="bytes",
                             number1_value=self.chance.randrange(10**6))
            else:
                point = dict(subsystem="com.vantor.Mail", category="Search", name="Done", string1_name="account",
                             string1_value=self.chance.choice(["imap", "home", "work"]))
            points.append((end - self.chance.uniform(0, 80_000), point))
        points.sort(key=lambda one: one[0])
        with open(os.path.join(self.root, "store", "day.export"), "w", encoding="utf-8") as file:
            file.writelines(trace_point(number, at, **point) for number, (at, point) in enumerate(points, 1))

    def report(self, days_ago, kill):
        """A run of the service. With `kill` one dies on the way, and the next removes what it left; the third is good."""
        self.record_day(days_ago)
        if kill:
            process = self.start("tessel_reporter", days_ago=days_ago)
            time.sleep(self.chance.uniform(0.1, 1))
            process.send_signal(signal.SIGKILL)
            if process.wait() == 0:
                return
            self.killed_services += 1
            self.finish(self.start("tessel_reporter", days_ago=days_ago))
        self.finish(self.start("tessel_reporter", days_ago=days_ago))

    def deliver(self, url, days_ago, kills):
        """Forwarders that are killed at any moment, and one that delivers the rest."""
        settings = {"OTEL_EXPORTER_OTLP_ENDPOINT": url, "TESSEL_FORWARD_FORMAT": "ndjson", "OTEL_EXPORTER_OTLP_COMPRESSION": "gzip",
                    "TESSEL_FORWARD_RATE": "0", "TESSEL_FORWARD_SPREAD": "0", "TESSEL_FORWARD_INTERVAL": "1",
                    "TESSEL_FORWARD_RETRY": "1", "TESSEL_FORWARD_HOLD": "2", "TESSEL_FORWARD_HEALTH": "1",
                    # The fleet is our own, and the queries are about machines.
                    "TESSEL_FORWARD_INSTANCE_ID": "1"}
        for _ in range(kills):
            process = self.start("statora_forwarder", days_ago=days_ago, **settings)
            time.sleep(self.chance.uniform(0.01, 0.2))
            process.send_signal(signal.SIGKILL)
            self.killed_forwarders += process.wait() == -signal.SIGKILL
        for _ in range(100):  # the store may be away for longer than one attempt lasts
            if self.start("statora_forwarder", "--once", days_ago=days_ago, **settings).wait() == 0:
                return
        raise RuntimeError(f"{self.root}: the rows do not leave; see its log")

    def finish(self, process):
        if process.wait() != 0:
            raise RuntimeError(f"{self.root}: {process.args[-1]} ended with {process.returncode}; see its log")

    def rows(self):
        """(id, time, name, payload) of every row that this machine's spool has had."""
        database = sqlite3.connect(self.spool)
        try:
            return [(*row[:3], json.loads(row[3])) for row in database.execute(
                "SELECT id, time, name, payload FROM forwarder_delivered UNION ALL SELECT id, time, name, payload FROM events"
                " UNION ALL SELECT id, time, name, payload FROM forwarder_set_aside ORDER BY id")]
        finally:
            database.close()
