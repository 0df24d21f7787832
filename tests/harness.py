"""Shared by the whole-service tests: makes stores, and runs the programs apart from this machine.

The service's run marker has a fixed path under /var/tmp, and the unit's lies in a directory under /var/lib. Each
Machine gives its programs others through a mount namespace. So tests can run side by side, and beside an installed
service.
"""
import contextlib
import json
import os
import re
import shutil
import signal
import sqlite3
import subprocess
import sys
import tempfile
import time
import unittest

BIN = os.path.abspath(os.environ.get("TESSEL_BIN") or os.path.join(os.path.dirname(__file__), "../build/dev/bin"))
SANITIZED = bool(os.environ.get("TESSEL_SANITIZE"))
REMOTE = "/lib/systemd/systemd-journal-remote"
MARKER = "tessel_reporter_running"
STATISTICS = "com.vantor.performance.tessel_reporting_stats"  # the last row of a run
CONTROL = re.compile(rb"[\x00-\x1f]")
DEFAULT_BOOT = "5f2b1c0d9e8a47b6a1d2c3e4f5061728"
TASKING = "com.vantor.performance.tessel_reporter_tasking.json"


class Entry:
    """One journal entry. `at` is in seconds relative to now, `mono` in microseconds since boot."""

    def __init__(self, fields, at=-60.0, mono=None, boot=DEFAULT_BOOT, exe="/opt/Clock.AppDir/usr/bin/Clock",
                 comm="Clock", pid=4711, uid=None, owner=None):
        self.fields, self.at, self.boot, self.exe, self.comm, self.pid = list(fields), at, boot, exe, comm, pid
        self.uid, self.owner = uid, owner
        self.mono = mono if mono is not None else int((1_000_000 + at) * 1_000_000)

    def realtime(self, now):
        return int((now + self.at) * 1_000_000)


def point(kind, subsystem, category, name=None, *, telemetry=True, string1=None, string2=None, number1=None,
          number2=None, attributes=(), interval=None, scope=None, duration=None, frame_rate=None, **entry):
    """A trace point as an Entry. Labelled values are (label, value) pairs; either may be None."""
    fields = [("MESSAGE", "tessel"), ("TESSEL_KIND", kind), ("TESSEL_SUBSYSTEM", subsystem),
              ("TESSEL_CATEGORY", category), ("TESSEL_NAME", name), ("TESSEL_INTERVAL_ID", interval),
              ("TESSEL_INTERVAL_SCOPE", scope), ("TESSEL_TELEMETRY", "1" if telemetry else None),
              ("TESSEL_DURATION", duration), ("TESSEL_FRAME_RATE", frame_rate)]
    for slot, pair in (("STRING1", string1), ("STRING2", string2), ("NUMBER1", number1), ("NUMBER2", number2)):
        if pair:
            fields += [(f"TESSEL_{slot}_NAME", pair[0]), (f"TESSEL_{slot}_VALUE", pair[1])]
    fields += [("TESSEL_ATTRIBUTE", f"{key}={value}") for key, value in attributes]
    return Entry([(key, str(value)) for key, value in fields if value is not None], **entry)


def some_points(count):
    return [point("event", "com.vantor.Calendar", "View", f"Open{i}", at=-600 + i * 0.01) for i in range(count)]


def log_event(text, **entry):
    """An entry that is no trace point."""
    return Entry([("MESSAGE", text), ("PRIORITY", "6")], **entry)


def _field(name, value):
    data = value if isinstance(value, bytes) else value.encode("utf-8", "surrogateescape")
    if CONTROL.search(data):
        return name.encode() + b"\n" + len(data).to_bytes(8, "little") + data + b"\n"
    return name.encode() + b"=" + data + b"\n"


def export_bytes(entries, now, first_sequence=1):
    """The entries in the Journal Export Format, entry by entry."""
    for number, entry in enumerate(entries, first_sequence):
        realtime = entry.realtime(now)
        cursor = f"s={'ab' * 16};i={number:x};b={entry.boot};m={entry.mono:x};t={realtime:x};x={number:x}"
        head = [("__CURSOR", cursor), ("__REALTIME_TIMESTAMP", str(realtime)),
                ("__MONOTONIC_TIMESTAMP", str(entry.mono)), ("_BOOT_ID", entry.boot)]
        trusted = [("_EXE", entry.exe), ("_COMM", entry.comm), ("_PID", str(entry.pid) if entry.pid else None),
                   ("_UID", None if entry.uid is None else str(entry.uid)),
                   ("_SYSTEMD_OWNER_UID", None if entry.owner is None else str(entry.owner))]
        fields = head + entry.fields + [pair for pair in trusted if pair[1] is not None]
        yield b"".join(_field(key, value) for key, value in fields) + b"\n"


def in_namespace_argv(var_tmp, command, read_only=(), var_lib=None, machine_id=None):
    # -n: otherwise mount makes /run/mount, on the machine itself.
    script = 'mount -n --bind "$0" /var/tmp && '
    script += f"mount -n --bind {var_lib} /var/lib && " if var_lib else ""
    script += f"mount -n --bind {machine_id} /etc/machine-id && " if machine_id else ""
    script += "".join(f"mount -n --bind {path} {path} && mount -n -o remount,bind,ro {path} && " for path in read_only)
    script += 'exec "$@"'
    unshare = ["unshare", "--mount"] if os.geteuid() == 0 else ["unshare", "--user", "--map-root-user", "--mount"]
    return unshare + ["--", "sh", "-c", script, var_tmp] + command


class Machine:
    """A trace store, a state and a configuration directory, and the programs run over them."""

    def __init__(self):
        self.root = tempfile.mkdtemp(prefix="tessel-test-")
        folders = [os.path.join(self.root, name) for name in ("store", "state", "config", "var_tmp", "var_lib")]
        self.store, self.state, self.config, self.var_tmp, self.var_lib = folders
        for folder in folders:
            os.mkdir(folder)
        self.machine_id = None  # another than this machine's
        self.read_only = []  # directories that the programs cannot write to, whoever runs them
        self.now = time.time()
        self.os_release = os.path.join(self.root, "os-release")
        self.set_internal(False)

    def close(self):
        shutil.rmtree(self.root, ignore_errors=True)

    def set_internal(self, internal):
        with open(self.os_release, "w", encoding="utf-8") as file:
            file.write("ID=debian\n" + ("VARIANT_ID=internal\n" if internal else ""))

    def task(self, text='{"TaskedOn": true}'):
        path = os.path.join(self.config, TASKING)
        with open(path + ".new", "w", encoding="utf-8") as file:
            file.write(text)
        os.rename(path + ".new", path)

    def write_export(self, entries, name="a.export", **kwargs):
        with open(os.path.join(self.store, name), "wb") as file:
            file.writelines(export_bytes(entries, self.now, **kwargs))

    def write_journal(self, entries, name="a.journal", environment=None, **kwargs):
        """A journal file with the entries, made by systemd-journal-remote."""
        self.now = time.time()
        export = os.path.join(self.root, name + ".source")
        with open(export, "wb") as file:
            file.writelines(export_bytes(entries, self.now, **kwargs))
        path = os.path.join(self.store, name)
        subprocess.run([REMOTE, "-o", path, export], check=True, capture_output=True,
                       env={**os.environ, **(environment or {})})
        os.unlink(export)
        return path

    def environment(self, **extra):
        inherited = {key: value for key, value in os.environ.items() if not key.startswith(("TESSEL_", "LC_"))}
        inherited.update(LANG="C.UTF-8", LC_ALL="en_US.UTF-8", TZ="UTC", TESSEL_TRACE_STORE=self.store, TESSEL_STATE_DIR=self.state,
                         TESSEL_CONFIG_DIR=self.config, TESSEL_OS_RELEASE=self.os_release, TESSEL_DEFER_ON="file",
                         TESSEL_LOG="stderr", TESSEL_LOG_LEVEL="debug")
        inherited.update({key: value for key, value in extra.items() if value is not None})
        for key, value in extra.items():
            if value is None:
                inherited.pop(key, None)
        return inherited

    def start(self, program="tessel_reporter", *arguments, **extra):
        """Starts a program; what it prints goes to files that result() reads."""
        command = in_namespace_argv(self.var_tmp, [os.path.join(BIN, program), *arguments], self.read_only,
                                    self.var_lib, self.machine_id_file())
        output = tempfile.TemporaryFile()
        errors = tempfile.TemporaryFile()
        process = subprocess.Popen(command, env=self.environment(**extra), stdout=output, stderr=errors,
                                   stdin=subprocess.DEVNULL)
        process.tessel_output, process.tessel_errors = output, errors
        return process

    def machine_id_file(self):
        if self.machine_id is None:
            return None
        path = os.path.join(self.root, "machine-id")
        with open(path, "w", encoding="utf-8") as file:
            file.write(self.machine_id + "\n" if self.machine_id else "")
        return path

    def result(self, process, timeout=120):
        """Waits for the program to end by itself; one that does not is killed and fails the test."""
        try:
            process.wait(timeout)
        except subprocess.TimeoutExpired:
            process.kill()
            process.wait()
            raise
        return Result(process)

    def run(self, **extra):
        """One run of the service, from start to end."""
        return self.result(self.start(**extra))

    def ctl(self, *arguments, **extra):
        return self.result(self.start("tesselctl", *arguments, **extra))

    def marker_exists(self):
        return os.path.lexists(os.path.join(self.var_tmp, MARKER))

    def record(self):
        """What the last run came to."""
        with open(os.path.join(self.state, "last_run.json"), encoding="utf-8") as file:
            return json.load(file)

    def rows(self):
        """(name, payload as a list of pairs) of each row of the spool, in order."""
        path = os.path.join(self.state, "statora.db")
        if not os.path.exists(path):
            return []
        with contextlib.closing(sqlite3.connect(path)) as database:
            if not database.execute("SELECT 1 FROM sqlite_master WHERE name = 'events'").fetchall():
                return []  # looked at in the moment between making the file and making the table
            rows = database.execute("SELECT name, payload FROM events ORDER BY id").fetchall()
        return [(name, json.loads(payload, object_pairs_hook=list)) for name, payload in rows]


class Result:
    def __init__(self, process):
        self.status = process.returncode
        self.out = self._read(process.tessel_output)
        self.errors = self._read(process.tessel_errors)

    @staticmethod
    def _read(file):
        with file:
            file.seek(0)
            return file.read().decode("utf-8", "surrogateescape")

    @property
    def log(self):
        """The service's messages, each without its final line feed."""
        return [text for level, text in self._lines() if level != "warning"]

    @property
    def warnings(self):
        """The platform's warnings, each without its final line feed."""
        return [text for level, text in self._lines() if level == "warning"]

    def _lines(self):
        lines = []
        for line in self.errors.splitlines():
            if line.startswith(("debug: ", "error: ", "warning: ")):
                lines.append(line.split(": ", 1))
            elif lines:
                lines[-1][1] += "\n" + line.strip()
        return lines


class MachineTest(unittest.TestCase):
    """A test case with a machine of its own, tasked on."""

    def setUp(self):
        self.machine = Machine()
        self.machine.task()
        self.addCleanup(self.machine.close)

    def assert_clean(self, result):
        self.assertEqual(result.status, 0, result.errors)
        return result

    def run_clean(self, **extra):
        """One run of the service, which ends well."""
        return self.assert_clean(self.machine.run(**extra))


def wait_for(condition, seconds=60):
    deadline = time.monotonic() + seconds
    while not condition():
        if time.monotonic() > deadline:
            raise AssertionError("timed out")
        time.sleep(0.005)


def require_root():
    assert os.geteuid() == 0, "only root can run programs as another user; leave this out with ./test dev -LE root"


def interrupt(process):
    process.send_signal(signal.SIGINT)


def what_is_missing():
    """Why the tests cannot run on this machine; None where they can."""
    for program in ("unshare", "mount", REMOTE):
        if not shutil.which(program):
            return f"{program} is missing: scripts/install-packages test"
    with tempfile.TemporaryDirectory() as folder:
        probe = subprocess.run(in_namespace_argv(folder, ["true"]), capture_output=True, text=True, check=False)
    return f"this machine gives no mount namespace: {probe.stderr.strip()}" if probe.returncode else None


def main():
    """Runs the tests of the script. A test that cannot run here fails: it must not look like one that passed."""
    missing = what_is_missing()
    if missing:
        sys.exit(f"{missing}\nLeave out the tests that need namespaces or root with: ./test dev -LE 'namespace|root'")
    unittest.main(verbosity=1)
