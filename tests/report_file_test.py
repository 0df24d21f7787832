#!/usr/bin/env python3
"""`tesselctl report --html FILE`: what becomes of the file, and of what is none."""
import os
import resource
import signal
import stat
import subprocess

import harness
from harness import BIN, SANITIZED, Entry, MachineTest, point


class ReportFiles(MachineTest):
    """As root, with files of nobody around."""
    NOBODY = 65534

    def setUp(self):
        super().setUp()
        harness.require_root()
        self.machine.write_export([point("event", "com.vantor.Calendar", "View", "Open")])
        os.chmod(self.machine.root, 0o755)
        self.folder = self.make_folder("out", 0o755)
        self.page = os.path.join(self.folder, "page.html")

    def make_folder(self, name, mode):
        path = os.path.join(self.machine.root, name)
        os.mkdir(path)
        os.chmod(path, mode)
        return path

    def make(self, path, mode=0o644, owner=0, group=0, text="old"):
        with open(path, "w", encoding="utf-8") as file:
            file.write(text)
        os.chmod(path, mode)
        os.chown(path, owner, group)
        return path

    def report(self, path, status=0, said=None, **extra):
        result = self.machine.ctl("report", "--html", path, **extra)
        self.assertEqual((result.status, result.errors.count("\n")), (status, 1 if status else 0), result.errors)
        if said:
            self.assertIn(f"{path}: {said}", result.errors)
        return result

    def as_nobody(self, path, **options):
        return subprocess.run([os.path.join(BIN, "tesselctl"), "report", "--html", path], env=self.machine.environment(),
                              stderr=subprocess.PIPE, check=False, user=self.NOBODY, group=self.NOBODY, extra_groups=[], **options)

    def assert_page(self, path, mode=None, owner=(0, 0)):
        facts = os.stat(path)
        if mode is not None:
            self.assertEqual((stat.S_IMODE(facts.st_mode), facts.st_uid, facts.st_gid), (mode, *owner))
        with open(path, encoding="utf-8") as file:
            self.assertRegex(file.read(), r"(?s)^<!DOCTYPE html>.*</html>\n$")

    def test_a_file_is_replaced_and_keeps_its_rights(self):
        self.report(self.page)
        self.assert_page(self.page, 0o600)
        self.make(self.page, 0o4640, self.NOBODY, self.NOBODY)
        twin = os.path.join(self.machine.root, "twin")
        os.link(self.page, twin)
        self.report(self.page)
        self.assert_page(self.page, 0o640, (self.NOBODY, self.NOBODY))
        with open(twin, encoding="utf-8") as file:
            self.assertEqual(file.read(), "old", "the old file was written to")
        os.chown(self.folder, self.NOBODY, self.NOBODY)
        os.chmod(self.machine.store, 0o755)
        self.make(self.page, 0o664, 0, 0)  # a file of root: nobody may replace it, but not give the new one to root's group
        self.assertEqual(self.as_nobody(self.page, umask=0).returncode, 0)
        self.assert_page(self.page, 0o604, (self.NOBODY, self.NOBODY))
        self.assertEqual(os.listdir(self.folder), ["page.html"])
        if not SANITIZED:  # a sanitizer cannot do without /proc itself
            self.assert_page(self.report_without_proc(), 0o600)

    def report_without_proc(self):
        """Where files without names cannot be used."""
        page = os.path.join(self.folder, "without-proc.html")
        script = 'mount -n -t tmpfs tmpfs /proc && exec "$0" report --html "$1"'
        subprocess.run(["unshare", "--mount", "sh", "-c", script, os.path.join(BIN, "tesselctl"), page],
                       env=self.machine.environment(), check=True)
        self.assertEqual(sorted(os.listdir(self.folder)), ["page.html", "without-proc.html"])
        return page

    def test_what_is_no_file_is_written_through(self):
        target, dangling, device, full, pipe = (os.path.join(self.folder, name) for name in ("target", "new", "null", "full", "pipe"))
        self.make(target, 0o640, self.NOBODY, self.NOBODY)
        os.mknod(device, stat.S_IFCHR | 0o666, os.makedev(1, 3))
        os.mknod(full, stat.S_IFCHR | 0o666, os.makedev(1, 7))
        os.mkfifo(pipe)
        links = {name: os.path.join(self.folder, "link-" + os.path.basename(name)) for name in ("target", "new", "null", "full", "pipe", "link-loop", "..", "/proc/self/fd/1")}
        for name, link in links.items():
            os.symlink(name.replace("link-loop", "link-link-loop"), link)
        before = {name: os.lstat(os.path.join(self.folder, name)).st_ino for name in os.listdir(self.folder)}
        self.report(links["target"])
        self.assert_page(target, 0o640, (self.NOBODY, self.NOBODY))
        self.report(links["new"])
        self.assert_page(dangling, 0o600)
        before["new"] = os.stat(dangling).st_ino
        for path in (device, links["null"]):
            self.report(path)
        for path in (full, links["full"]):
            self.report(path, 1, "No space left on device")
        self.report(links["link-loop"], 1, "Too many levels of symbolic links")
        for path in (links[".."], self.folder, self.folder + "/", self.folder + "/."):
            self.report(path, 1, "Is a directory")
        self.assertEqual(self.machine.ctl("report", "--html", "").status, 2)
        for path in (pipe, links["pipe"]):
            with subprocess.Popen(["timeout", "60", "cat", pipe], stdout=subprocess.PIPE) as reader:
                self.report(path)
                self.assertIn(b"</html>", reader.stdout.read())
        self.assertIn("</html>\n", self.report(links["/proc/self/fd/1"]).out)
        self.assertEqual({name: os.lstat(os.path.join(self.folder, name)).st_ino for name in os.listdir(self.folder)}, before)

    def test_no_trap_in_a_shared_folder_works(self):
        victim = self.make(os.path.join(self.machine.root, "victim"), 0o644)
        shared = self.make_folder("shared", 0o1777)
        traps = [os.path.join(shared, name) for name in ("file", "link", "dangling", "pipe")]
        self.make(traps[0], 0o666, self.NOBODY, self.NOBODY)
        os.symlink(victim, traps[1])
        os.symlink(os.path.join(self.machine.root, "made"), traps[2])
        os.mkfifo(traps[3])
        for trap in traps:
            os.chown(trap, self.NOBODY, self.NOBODY, follow_symlinks=False)
            self.report(trap, 1, f"it belongs to user {self.NOBODY}")
        with open(victim, encoding="utf-8") as file:
            self.assertEqual(file.read(), "old")
        own = self.make(os.path.join(shared, "own"))
        link = os.path.join(shared, "own-link")
        os.symlink(victim, link)
        for path in (own, link, os.path.join(shared, "fresh")):
            self.report(path)
        self.assert_page(victim, 0o644)
        self.assertEqual(sorted(os.listdir(shared)), sorted([*map(os.path.basename, traps), "own", "own-link", "fresh"]))

    def test_nothing_is_left_behind(self):
        self.make(self.page)
        full = ["unshare", "--mount", "sh", "-c", 'mount -n -t tmpfs -o size=8k tmpfs "$1" && echo old >"$1/page.html" && '
                '"$0" report --html "$1/page.html"; echo $?; cat "$1/page.html"; ls -A "$1"', os.path.join(BIN, "tesselctl"), self.folder]
        result = subprocess.run(full, env=self.machine.environment(), capture_output=True, text=True, check=True)
        self.assertEqual((result.stdout.split(), result.stderr),
                         (["1", "old", "page.html"], f"tesselctl: {self.page}: No space left on device\n"))
        limit = lambda: resource.setrlimit(resource.RLIMIT_FSIZE, (4096, 4096))
        os.chown(self.folder, self.NOBODY, self.NOBODY)
        result = self.as_nobody(self.page, preexec_fn=limit)
        self.assertEqual((result.returncode, result.stderr.decode()), (1, f"tesselctl: {self.page}: File too large\n"))
        self.assertEqual(os.listdir(self.folder), ["page.html"])
        shim = os.path.join(BIN, "fault_shim.so")  # flushes take seconds with it
        struck = os.path.join(self.machine.root, "struck")
        for number, whole in ((signal.SIGKILL, False), (signal.SIGTERM, True), (signal.SIGINT, True), (signal.SIGHUP, True)):
            self.make(self.page)
            process = self.machine.start("tesselctl", "report", "--html", self.page, LD_PRELOAD=shim, FAULT_SLOW="1000", FAULT_STRUCK=struck,
                                         ASAN_OPTIONS="verify_asan_link_order=0")
            harness.wait_for(lambda: os.path.exists(struck))
            process.send_signal(number)
            self.assertEqual(self.machine.result(process).status, -number)
            os.unlink(struck)
            self.assertEqual(os.listdir(self.folder), ["page.html"])
            with open(self.page, encoding="utf-8") as file:
                self.assertEqual(file.read().endswith("</html>\n"), whole)

    def test_a_page_to_pass_on_names_nobody(self):
        private = {"value": "hunter2", "number": "8675309", "label": "password", "attribute": "diary", "image": "/home/alice/secret/bin/app",
                   "name": "secretcomm", "uid": "54321", "unit": "alice-secret.service", "file": "damaged-by-alice", "host": "alices-laptop",
                   "store": self.machine.store, "state": self.machine.state}
        writer = dict(exe=private["image"], comm=private["name"], uid=int(private["uid"]))
        self.machine.write_export(
            [point("event", "com.vantor.Calendar", "View", "Open", string1=(private["label"], private["value"]),
                   number1=(private["label"], private["number"]), attributes=[("diary", private["attribute"])], **writer),
             Entry([("_TRANSPORT", "driver"), ("MESSAGE_ID", "a596d6fe7bfa4994828e72309e95d61e"), ("N_DROPPED", "7"),
                    ("OBJECT_SYSTEMD_UNIT", private["unit"])], at=-30)])
        with open(os.path.join(self.machine.store, private["file"] + ".export"), "wb") as file:
            file.write(b"no equals sign\n\n")
        self.run_clean()
        # More pairs than the reader keeps. The run did not meet them, since its sends would take minutes.
        self.machine.write_export([point("event", f"com.vantor.Flood{i}", "A", at=-300 + i / 100, **writer) for i in range(4200)], "b.export",
                                  first_sequence=9)
        pages = {}
        for arguments in ((), ("--last-run",)):
            for option in ((), ("--without-values",)):
                command = ["unshare", "--uts", "sh", "-c", 'hostname "$0" && exec "$@"', private["host"], os.path.join(BIN, "tesselctl"),
                           "report", "--html", self.page, *arguments, *option]
                subprocess.run(command, env=self.machine.environment(), check=True)
                with open(self.page, encoding="utf-8") as file:
                    pages[option] = file.read().replace("<wbr>", "")
            whole, to_pass_on = pages.values()
            for what in ("value", "image", "uid", "unit", "file", "host", "store"):
                self.assertIn(private[what], whole, what)
            for what, text in private.items():
                self.assertNotIn(text, to_pass_on, what)
            for page in (whole, to_pass_on):
                for text in ("com.vantor.Calendar", "View", "Open", "dropped_by_daemon", "beyond_pair_limit", "file_damaged"):
                    self.assertIn(text, page)


if __name__ == "__main__":
    harness.main()
