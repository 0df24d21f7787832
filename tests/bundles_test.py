#!/usr/bin/env python3
"""Whoever runs a program chooses the directory it lies in. None of them stops or misleads a bundle look-up."""
import ctypes
import itertools
import json
import os
import stat
import subprocess
import sys
import time

import harness
from harness import MachineTest, point
from measure import anonymous_memory
from mixed_day import make_bundle

LIBC = ctypes.CDLL(None, use_errno=True)
NEW_MOUNTS, RECURSIVE, PRIVATE, DETACH = 0x20000, 0x4000, 1 << 18, 2
IN_NONBLOCK, IN_OPEN, EXCHANGE, HERE = 0x800, 0x20, 2, -100
EXE = os.path.join("{}", "usr/bin/Clock")


def checked(result):
    if result < 0:
        raise OSError(ctypes.get_errno(), os.strerror(ctypes.get_errno()))
    return result


def event(i, exe, **fields):
    return point("event", "com.vantor.Calendar", "View", f"Open{i}", exe=exe, at=-600 + i * 0.01, **fields)


class BundlesTest(MachineTest):
    def names(self, rows):
        return [dict(payload)["StartProcessName"] for name, payload in rows if name == "com.vantor.performance.tessel"]

    def explained(self, **extra):
        result = self.machine.result(self.machine.start("tesselctl", "explain", "--json", "--payload", **extra), 60)
        self.assertEqual((result.status, result.errors), (0, ""))
        return [json.loads(line)["payload"]["StartProcessName"] for line in result.out.splitlines()]


class DeadServer(BundlesTest):
    """A mount whose server never answers. Whoever touches it waits for ever."""

    def setUp(self):
        super().setUp()
        # Not the mounts of this machine: every program on it would wait.
        checked(LIBC.unshare(NEW_MOUNTS))
        checked(LIBC.mount(None, b"/", None, RECURSIVE | PRIVATE, None))
        self.dead = self.mounted("dead")

    def mounted(self, name):
        path = os.path.join(self.machine.root, name)
        os.makedirs(path, exist_ok=True)
        server = os.open("/dev/fuse", os.O_RDWR)
        options = f"fd={server},rootmode=40000,user_id=0,group_id=0,allow_other".encode()
        checked(LIBC.mount(b"dead", path.encode(), b"fuse", 0, options))
        self.addCleanup(os.close, server)  # frees whoever waits
        self.addCleanup(LIBC.umount2, path.encode(), DETACH)
        return path

    def test_a_run_touches_nothing_on_it(self):
        live = make_bundle(self.machine, "Clock.AppDir", "com.vantor.Clock")
        links = os.path.join(self.machine.root, "links")
        for link, target in (("usr", "."), ("Clock.AppDir", self.dead + "/x"), ("Clock.a", "../dead")):
            os.makedirs(links, exist_ok=True)
            os.symlink(target, os.path.join(links, link))
        metainfo = os.path.dirname(make_bundle(self.machine, "Clock.b", "com.vantor.B"))[:-len("usr/bin")]
        os.unlink(metainfo + "usr/share/metainfo/a.metainfo.xml")
        self.mounted("Clock.b/usr/share/metainfo")
        self.mounted("Clock.c")
        exes = [EXE.format(os.path.join(self.machine.root, bundle)) for bundle in
                ("dead/Clock.AppDir", "dead/a/b/Clock.AppDir", "links/Clock.AppDir", "links/Clock.a", "Clock.b", "Clock.c")]
        self.machine.write_export([event(i, exes[i % len(exes)]) for i in range(50)] +
                                  [event(i, live) for i in range(50, 100)])
        wanted = ["Clock"] * 50 + ["com.vantor.Clock"] * 50
        self.assertEqual(self.explained(), wanted)
        result = self.assert_clean(self.machine.result(self.machine.start(), 60))
        self.assertEqual(self.names(self.machine.rows()), wanted, result.errors)


class Swapped(BundlesTest):
    """Metadata that turns into a pipe, and back, some hundred thousand times a second."""

    SWAPPER = f"""
import ctypes, sys
libc = ctypes.CDLL(None)
one, other = (name.encode() for name in sys.argv[1:])
while libc.renameat2({HERE}, one, {HERE}, other, {EXCHANGE}) == 0: pass
"""

    def test_nothing_but_regular_files_is_opened(self):
        metadata = os.path.join(self.machine.root, "Clock.AppDir/usr/share/metainfo/a.metainfo.xml")
        make_bundle(self.machine, "Clock.AppDir", "com.vantor.Clock")
        pipe, outside = (os.path.join(self.machine.root, name) for name in ("Clock.AppDir/pipe", "outside"))
        os.mkfifo(pipe)
        os.mkfifo(outside)
        link = os.path.join(self.machine.root, "Clock.AppDir/link")
        os.symlink(outside, link)
        # Each path of an image costs a look-up of its own.
        self.machine.write_export([event(i, EXE.format(f"{self.machine.root}/Clock.AppDir/{i}")) for i in range(2000)])
        opened = checked(LIBC.inotify_init1(IN_NONBLOCK))
        self.addCleanup(os.close, opened)
        for path in (pipe, outside):
            checked(LIBC.inotify_add_watch(opened, path.encode(), IN_OPEN))
        for other in (pipe, link):
            with subprocess.Popen([sys.executable, "-c", self.SWAPPER, metadata, other]) as swapper:
                harness.wait_for(lambda: not stat.S_ISREG(os.lstat(metadata).st_mode))
                seen = self.explained()
                self.assertIsNone(swapper.poll(), "it swapped until now")
                swapper.kill()
            self.assertEqual(set(seen), {"com.vantor.Clock", "Clock"}, "both were met")
            with self.assertRaises(BlockingIOError, msg="one was opened"):
                os.read(opened, 4096)
            if not stat.S_ISREG(os.lstat(metadata).st_mode):
                checked(LIBC.renameat2(HERE, metadata.encode(), HERE, other.encode(), EXCHANGE))


class ManyPrograms(BundlesTest):
    def test_their_paths_do_not_fill_the_memory(self):
        """Some 29,000 paths of 3.9 KB: they would take 113 MB."""
        long = "/".join(["d" * 200] * 19)
        paths = [f"/opt/{long}/{i}/Clock" for i in range(29_000)]
        self.machine.write_export(itertools.starmap(event, enumerate(paths)))
        # One writer's share of the 4 MiB that a run has for paths.
        share = sum(total <= (4 << 20) * 9 // 16 for total in itertools.accumulate(map(len, paths)))
        process = self.machine.start("tesselctl", "explain", "--json", "--payload", TESSEL_LOG_LEVEL="error")
        peak = 0
        while process.poll() is None:
            peak = max(peak, anonymous_memory(process.pid))
            time.sleep(0.01)
        result = self.machine.result(process)
        self.assertEqual((result.status, result.out.count("\n")), (0, share))
        print(f"peak {peak} KiB")
        if not harness.SANITIZED:
            self.assertLess(peak, 64 << 10)


if __name__ == "__main__":
    harness.require_root()
    harness.main()
