#!/usr/bin/env python3
"""Our journal reader beside libsystemd and journalctl, on what the journal's own tools write.

Runs beside a live daemon (see with-journald).
"""

import argparse
import itertools
import json
import os
import random
import re
import shutil
import signal
import socket
import subprocess
import sys
import tempfile
import threading
import time
import unittest

OPTIONS = None
LIVE = "/var/log/journal"
START = 1_795_300_000_000_000


def exported(count, source=0, boots=1, start=START, clock=lambda index: 0):
    """Entries in the Journal Export Format a millisecond apart, with repeated, binary and large fields."""
    text, rng = [], random.Random(source)
    for index in range(count):
        boot = index * boots // count
        text.append(f"__REALTIME_TIMESTAMP={start + index * 1000 + clock(index)}\n"
                    f"__MONOTONIC_TIMESTAMP={start % 10**9 + (index - boot * count // boots) * 1000}\n"
                    f"_BOOT_ID={boot + 1:032x}\nMESSAGE=message {source} {index}\n_PID={index % 50}\nPRIORITY=6\n".encode())
        if index % 7 == 0:
            text.append(b"LARGE=" + rng.randbytes(20).hex().encode() * (50 + index % 150) + b"\n")
        if index % 9 == 0:
            text.append(f"TESSEL_ATTRIBUTE=a={index}\nTESSEL_ATTRIBUTE=b=\nTESSEL_KIND={index % 2}\n".encode())
        if index % 11 == 0:
            text.append(b"BINARY\n\x07\0\0\0\0\0\0\0a\nb\0\n\n\xff\n")
        text.append(b"\n")
    return b"".join(text)


def read(path, *mode, **options):
    """What compare_readers says, its exit status and the figures of its first line."""
    result = subprocess.run([OPTIONS.compare, *mode, path], capture_output=True, text=True, errors="replace",
                            timeout=300, check=False, **options)
    result.figures = {name: int(value) for name, value in re.findall(r"(\w+) (\d+)", result.stdout.split("\n")[0])}
    return result


class ReadingTest(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.folder = folder.name
        os.chmod(self.folder, 0o755)

    def make(self, name, text, compact=True, keyed=True, compress=True):
        path = os.path.join(self.folder, name)
        environment = {**os.environ, "SYSTEMD_JOURNAL_COMPACT": str(int(compact)),
                       "SYSTEMD_JOURNAL_KEYED_HASH": str(int(keyed))}
        subprocess.run(["/lib/systemd/systemd-journal-remote", f"--compress={compress}", "-o", path, "-"], input=text,
                       env=environment, capture_output=True, check=True)
        return path

    def assert_all_agree(self, path, **figures):
        result = read(path)
        self.assertEqual(result.returncode, 0, result.stdout)
        self.assertEqual(result.stdout.count("\n"), 1, result.stdout)
        self.assertEqual(result.figures, {**result.figures, **figures, "repeated": 0})
        return result.figures


class Files(ReadingTest):
    def test_every_layout_boots_and_a_clock_set_back(self):
        text = exported(2000, boots=3, clock=lambda index: -800_000 if index > 300 else 0)
        for compact, keyed, compress in itertools.product((False, True), repeat=3):
            with self.subTest(compact=compact, keyed=keyed, compress=compress):
                journal = self.make("a.journal", text, compact, keyed, compress)
                self.assert_all_agree(journal, entries=2000, spared=2000 - 2000 // 9 - 1)
                os.unlink(os.path.join(self.folder, "a.journal"))

    def test_several_sources_and_files_that_overlap(self):
        first = self.make("a.journal", exported(1000))
        shutil.copy(first, os.path.join(self.folder, "copy.journal"))
        self.make("a.journal", exported(500, start=START + 10**6))
        self.make("b.journal", exported(1500, source=1, start=START + 333), compact=False)
        archived = self.make("c.journal", exported(700, source=2, start=START + 500_000), keyed=False)
        os.rename(archived, archived + "~")
        self.assert_all_agree(self.folder, entries=3700, duplicates=1000, files=4)

    def test_what_has_no_permission_is_named(self):
        hidden = self.make("a.journal", exported(10))
        os.chmod(hidden, 0o600)
        os.chmod(self.make("b.journal", exported(10, source=1)), 0o644)
        closed = os.path.join(self.folder, "closed")
        os.mkdir(closed, 0o700)
        result = read(self.folder, "--ours", user=65534, group=65534, extra_groups=[])
        self.assertEqual(result.figures["entries"], 10)
        self.assertIn(f"skipped {hidden}: Permission denied", result.stdout)
        self.assertIn(f"skipped {closed}: Permission denied", result.stdout)


class Live(ReadingTest):
    def send(self, count):
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as sender:
            for number in range(count):
                sender.sendto(f"MESSAGE=point {number}\nTESSEL_KIND=event\nTESSEL_NAME=Open{number % 9}\n".encode(),
                              "/run/systemd/journal/socket")

    def wait_for(self, condition):
        end = time.monotonic() + 20
        while not condition():
            self.assertLess(time.monotonic(), end)
            time.sleep(0.02)

    def sync(self, *where):
        command = ["journalctl", *where, "--sync"]
        self.wait_for(lambda: subprocess.run(command, capture_output=True, check=False).returncode == 0)

    def online(self):
        with open(os.path.join(LIVE, self.machine(), "system.journal"), "rb") as file:
            return file.read(17)[16] == 1

    def test_every_kind_of_file_of_a_live_daemon(self):
        for user in (None, 1000, 1001):
            subprocess.run(["systemd-cat"], input=b"line\n" * 50, user=user, check=True)
        self.send(500)
        self.sync()
        self.assertGreaterEqual(self.assert_all_agree(LIVE)["files"], 3)
        subprocess.run(["journalctl", "--rotate"], check=True)
        self.sync()
        self.send(100)
        self.wait_for(self.online)
        os.kill(int(os.environ["JOURNALD_PID"]), signal.SIGKILL)
        self.assert_all_agree(LIVE)
        daemon = subprocess.Popen(["/lib/systemd/systemd-journald"], stderr=subprocess.DEVNULL)
        self.addCleanup(daemon.wait)
        self.addCleanup(daemon.terminate)
        self.sync()
        self.send(10)
        self.sync()
        self.assertTrue(any(name.endswith(".journal~") for name in os.listdir(os.path.join(LIVE, self.machine()))))
        self.assertGreaterEqual(self.assert_all_agree(LIVE)["entries"], 660)

    def test_a_healthy_machine_is_told_nothing(self):
        """Two users, a log namespace with a daemon of its own, and rotations while we read."""
        os.mkdir("/run/systemd/journal.web")
        web = subprocess.Popen(["/lib/systemd/systemd-journald", "web"], stderr=subprocess.DEVNULL)
        self.addCleanup(lambda: shutil.rmtree(os.path.join(LIVE, self.machine() + ".web")))
        self.addCleanup(web.wait)
        self.addCleanup(web.terminate)
        self.wait_for(lambda: os.path.exists("/run/systemd/journal.web/socket"))
        self.sync("--namespace=web")
        before = self.points()
        script = ("import socket, sys; s = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM); s.connect(sys.argv[1])\n"
                  "for n in range(25): s.send(b'TESSEL_KIND=event\\nTESSEL_SUBSYSTEM=a\\nTESSEL_CATEGORY=b\\n')\n"
                  "sys.stdin.read()")
        sent = [0]

        def write():
            for number in range(24):
                web, where = number % 3 == 0, ["--namespace=web"] if number % 3 == 0 else []
                # The daemon reads from /proc who sent an entry, so the sender stays until then.
                with subprocess.Popen([sys.executable, "-c", script, f"/run/systemd/journal{'.web' * web}/socket"],
                                      user=(1000, 1001, 0)[number // 3 % 3], stdin=subprocess.PIPE) as sender:
                    self.wait_for(lambda: self.lines(sender.pid, *where) == 25)
                sent[0] += 25
                if number % 2 == 0:
                    subprocess.run(["journalctl", *where, "--rotate"], check=True)

        writer = threading.Thread(target=write)
        writer.start()
        writing = True
        while writing:
            writing, least = writer.is_alive(), before + sent[0]
            self.assertGreaterEqual(self.points(), least)
        self.assertEqual(self.points(), before + 24 * 25)
        for folder in (self.machine(), self.machine() + ".web"):
            self.assertLessEqual({"user-1000.journal", "user-1001.journal"}, set(os.listdir(os.path.join(LIVE, folder))))

    def machine(self):
        with open("/etc/machine-id", encoding="ascii") as file:
            return file.read().strip()

    def lines(self, pid, *where):
        self.sync(*where)
        command = ["journalctl", *where, "-q", "-o", "cat", "--output-fields=TESSEL_KIND", f"_PID={pid}"]
        return subprocess.run(command, capture_output=True, text=True, check=True).stdout.count("event")

    def points(self):
        """The trace points of the machine's journal. Nothing is told lost, damaged or skipped."""
        tesselctl = os.path.join(os.path.dirname(OPTIONS.compare), "tesselctl")
        said = subprocess.run([tesselctl, "explain", "--summary", "--json"], capture_output=True, text=True, check=True)
        summary = json.loads(said.stdout)
        self.assertEqual([file for file in summary["files"] if file["problems"]], [], said.stdout)
        self.assertEqual(summary["losses"], [], said.stdout)
        return summary["trace_objects"]

    def test_a_rotation_neither_loses_nor_doubles_entries(self):
        sent = [0]

        # The daemon keeps 100 files, so none is vacuumed here.
        def rotate():
            for _ in range(50):
                self.send(200)
                self.sync()
                sent[0] += 200
                subprocess.run(["journalctl", "--rotate"], check=True)

        self.sync()
        before = read(LIVE, "--ours").figures.get("entries", 0)
        rotator = threading.Thread(target=rotate)
        rotator.start()
        rotating = True
        while rotating:
            rotating, least = rotator.is_alive(), before + sent[0]
            result = read(LIVE, "--ours")
            self.assertGreaterEqual(result.figures["entries"], least)
            self.assertEqual(result.figures["repeated"], 0)
            self.assertNotIn("problem", result.stdout)


if __name__ == "__main__":
    parser = argparse.ArgumentParser()
    parser.add_argument("--compare", required=True)
    OPTIONS, rest = parser.parse_known_args()
    unittest.main(argv=[__file__, *rest])
