#!/usr/bin/env python3
"""Checks units, manual pages, catalog and scripts without installing them."""

import glob
import os
import re
import shutil
import subprocess
import tempfile
import unittest

PACKAGING = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
ROOT = os.path.dirname(PACKAGING)
SYSTEMD = os.path.join(PACKAGING, "systemd")
REPORTER = os.path.join(SYSTEMD, "tessel-reporter.service")
FORWARDER = os.path.join(SYSTEMD, "statora-forwarder.service")
TIMER = os.path.join(SYSTEMD, "tessel-reporter.timer")
STATUS = os.path.join(SYSTEMD, "tessel-status.service")
STATUS_TIMER = os.path.join(SYSTEMD, "tessel-status.timer")


def run(*command, **options):
    assert shutil.which(command[0]), command[0] + " is missing: scripts/install-packages test"
    return subprocess.run(command, capture_output=True, text=True, check=False, **options)


def analyze(*arguments):
    """systemd-analyze as root notes under /run that it read units, so root gives it another /run."""
    apart = ["unshare", "--mount", "sh", "-c", 'mount -n -t tmpfs tmpfs /run && exec "$@"', "sh"]
    return run(*(apart if os.geteuid() == 0 else []), "systemd-analyze", *arguments)


def settings(path):
    """All values of each setting of a unit, in order."""
    found = {}
    with open(path, encoding="utf-8") as unit:
        for line in unit:
            if "=" in line and not line.startswith("#"):
                key, value = line.rstrip("\n").split("=", 1)
                found.setdefault(key, []).append(value)
    return found


def exposure(path):
    output = analyze("security", "--offline=true", "--no-pager", path)
    found = re.search(r"exposure level for \S+: ([0-9.]+)", output.stdout)
    assert found, output.stdout + output.stderr
    return float(found.group(1))


class Units(unittest.TestCase):
    def test_exposure(self):
        self.assertLessEqual(exposure(REPORTER), 0.5)
        self.assertLessEqual(exposure(FORWARDER), 1.2)
        self.assertLessEqual(exposure(STATUS), 0.5)

    def test_verify(self):
        with tempfile.TemporaryDirectory() as directory:
            # The programs and their users are not installed here: stand-ins take their place.
            for path in (REPORTER, FORWARDER, TIMER, STATUS, STATUS_TIMER):
                with open(path, encoding="utf-8") as unit:
                    text = re.sub(r"(?m)^ExecStart=\S+", "ExecStart=/bin/true", unit.read())
                    text = re.sub(r"(?m)^(Documentation|User|Group|SupplementaryGroups)=.*\n", "", text)
                with open(os.path.join(directory, os.path.basename(path)), "w", encoding="utf-8") as out:
                    out.write(text)
            for name in sorted(os.listdir(directory)):
                result = analyze("verify", "--man=no", os.path.join(directory, name))
                self.assertEqual(result.returncode, 0, result.stderr)
                self.assertNotIn(name.split(".")[0], result.stderr, result.stderr)

    def test_the_marker_and_the_pressure_stay_in_sight(self):
        unit = settings(REPORTER)
        for setting in ("DynamicUser", "PrivateTmp"):
            self.assertNotIn("yes", unit.get(setting, []), setting)
        self.assertEqual(unit["BindPaths"], ["/var/lib/tessel-marker:/var/tmp"])
        self.assertNotIn("pid", unit.get("ProcSubset", []))

    def test_life_of_the_service(self):
        unit = settings(REPORTER)
        for setting, value in {"Type": "notify", "KillSignal": "SIGINT", "PrivateNetwork": "yes",
                               "User": "tessel-reporter", "SupplementaryGroups": "systemd-journal",
                               "StateDirectory": "tessel", "ConfigurationDirectory": "tessel",
                               "MemoryMax": "128M"}.items():
            self.assertEqual(unit.get(setting), [value], setting)
        self.assertIn("WatchdogSec", unit)

    def test_the_status_is_the_services_own_view(self):
        look, service = settings(STATUS), settings(REPORTER)
        # Users, mounts and sandbox are the same, so that the look finds what the service finds.
        own = {"Description", "Documentation", "Type", "ExecStart", "KillSignal", "TimeoutStopSec", "WatchdogSec",
               "SuccessExitStatus", "TimeoutStartSec", "Environment"}
        for setting in (set(look) | set(service)) - own:
            self.assertEqual(look.get(setting), service.get(setting), setting)
        self.assertEqual(look["SuccessExitStatus"], ["1"])
        self.assertEqual(settings(STATUS_TIMER)["OnCalendar"], ["*:0/10"])

    def test_the_timer_keeps_its_distance(self):
        timer = settings(TIMER)
        for setting, value in {"OnCalendar": "daily", "RandomizedDelaySec": "6h",
                               "FixedRandomDelay": "true", "AccuracySec": "1min",
                               "Persistent": "true"}.items():
            self.assertEqual(timer.get(setting), [value], setting)

    def test_the_forwarder_waits_for_an_endpoint(self):
        unit = settings(FORWARDER)
        self.assertEqual(unit["EnvironmentFile"], ["-/etc/statora/forwarder.env"], "a drop-in may have the settings instead")
        self.assertIn("78", unit["RestartPreventExitStatus"], "without an address it is not started again and again")
        self.assertNotEqual(unit["User"], settings(REPORTER)["User"])
        with open(os.path.join(ROOT, "debian", "statora-forwarder.postinst"), encoding="utf-8") as script:
            self.assertNotRegex(script.read(), r"(?m)^\s*(systemctl|deb-systemd-helper) (--\S+ )*enable")

class Accounts(unittest.TestCase):
    def test_users_and_directories_can_be_made(self):
        self.assertEqual(os.geteuid(), 0, "only root can give files to other users; leave this out with -LE root")
        with tempfile.TemporaryDirectory() as root:
            # Of the groups of a Debian system, the units name this one.
            os.makedirs(os.path.join(root, "etc"))
            with open(os.path.join(root, "etc", "group"), "w", encoding="utf-8") as group:
                group.write("root:x:0:\nsystemd-journal:x:101:\n")
            for kind in ("sysusers", "tmpfiles"):
                for path in sorted(glob.glob(os.path.join(SYSTEMD, "*." + kind)), reverse=True):
                    create = ["--create"] if kind == "tmpfiles" else []
                    result = run("systemd-" + kind, "--root=" + root, *create, path)
                    self.assertEqual(result.returncode, 0, path + ": " + result.stderr)
            with open(os.path.join(root, "etc", "group"), encoding="utf-8") as group:
                members = dict((line.split(":")[0], line.rstrip("\n").split(":")[3]) for line in group)
            self.assertEqual(members["systemd-journal"], "tessel-reporter")
            self.assertEqual(members["tessel-reporter"], "statora-forwarder")
            with open(os.path.join(root, "etc", "passwd"), encoding="utf-8") as users:
                service = [int(user.split(":")[2]) for user in users if user.startswith("tessel-reporter:")]
            marker = os.stat(os.path.join(root, "var", "lib", "tessel-marker"))
            self.assertEqual(([marker.st_uid], marker.st_mode & 0o7777), (service, 0o700))


class MaintainerScripts(unittest.TestCase):
    """The scripts of the package, run as root in a mount namespace with other directories and stand-ins for the
    programs that would change this machine. Those that look for the marker and move it are the real ones."""

    SERVICE, STRANGER = 54321, 65534
    STAND_INS = {"systemctl": 'case "$*" in *ActiveState*) echo "$ACTIVE_STATE" ;; esac',
                 "systemd-tmpfiles": f"mkdir -p -m 700 /var/lib/tessel-marker && chown {SERVICE}:{SERVICE} /var/lib/tessel-marker",
                 **dict.fromkeys(("systemd-sysusers", "deb-systemd-helper", "deb-systemd-invoke", "journalctl",
                                  "userdel", "groupdel"), "true")}
    SERVICE_FILE = (SERVICE, "file")
    OTHERS = ((STRANGER, "file"), (SERVICE, "link"), (SERVICE, "directory"), (SERVICE, "fifo"))

    def setUp(self):
        self.assertEqual(os.geteuid(), 0, "only root can play other users; leave this out with -LE root")

    def lay_out(self, root, marker):
        for folder in ("etc", "run/systemd/system", "var/lib", "var/tmp", "bin"):
            os.makedirs(os.path.join(root, folder))
        os.chmod(os.path.join(root, "var/tmp"), 0o1777)
        for name, text in (("passwd", "tessel-reporter:x:%d:%d::/:/bin/false"), ("group", "tessel-reporter:x:%d:")):
            with open(os.path.join(root, "etc", name), "w", encoding="utf-8") as file:
                file.write("root:x:0:0::/root:/bin/sh\n" * (name == "passwd") + text % ((self.SERVICE,) * text.count("%")) + "\n")
        for name, text in self.STAND_INS.items():
            with open(os.path.join(root, "bin", name), "w", encoding="utf-8") as file:
                file.write("#!/bin/sh\n" + text + "\n")
            os.chmod(file.name, 0o755)
        owner, kind = marker
        path = os.path.join(root, "var/tmp/tessel_reporter_running")
        victim = os.path.join(root, "var/tmp/victim")
        for file in [victim] + [path] * (kind == "file"):
            os.close(os.open(file, os.O_CREAT, 0o644))
            os.chown(file, self.SERVICE, self.SERVICE)
        {"file": lambda: os.utime(path, (1, 1)), "link": lambda: os.symlink("victim", path),
         "directory": lambda: os.mkdir(path), "fifo": lambda: os.mkfifo(path)}[kind]()
        os.chown(path, owner, owner, follow_symlinks=False)

    def after(self, marker, script, *arguments, active="inactive", installed=False):
        """(whether the shared marker is there, the marker in the directory of the unit) after the script."""
        with tempfile.TemporaryDirectory() as root:
            self.lay_out(root, marker)
            if installed:
                os.mkdir(os.path.join(root, "var/lib/tessel-marker"))
            binds = "".join(f"mount -n --bind {root}/{folder} /{folder} && " for folder in ("etc", "run", "var/lib", "var/tmp"))
            result = run("unshare", "--mount", "sh", "-c", binds + 'exec sh "$@"', "sh",
                         os.path.join(ROOT, "debian", "tessel-reporter." + script), *arguments,
                         env={"PATH": f"{root}/bin:/usr/sbin:/usr/bin:/sbin:/bin", "ACTIVE_STATE": active})
            self.assertEqual(result.returncode, 0, result.stderr)
            self.assertTrue(os.path.exists(os.path.join(root, "var/tmp/victim")))
            self.assertEqual(os.path.isdir(os.path.join(root, "var/lib/tessel-marker")), script == "postinst")
            brought = os.path.join(root, "var/lib/tessel-marker/tessel_reporter_running")
            facts = os.lstat(brought) if os.path.lexists(brought) else None
            return (os.path.lexists(os.path.join(root, "var/tmp/tessel_reporter_running")),
                    facts and (facts.st_uid, facts.st_mode, facts.st_mtime))

    def test_an_upgrade_brings_the_marker_once(self):
        upgrade = ("postinst", "configure", "0.0.1")
        self.assertEqual(self.after(self.SERVICE_FILE, *upgrade), (False, (self.SERVICE, 0o100660, 1)))
        for active in ("active", "activating", "deactivating"):
            self.assertEqual(self.after(self.SERVICE_FILE, *upgrade, active=active), (True, None), active)
        self.assertEqual(self.after(self.SERVICE_FILE, *upgrade, installed=True), (True, None))
        for marker in self.OTHERS:
            self.assertEqual(self.after(marker, *upgrade), (True, None), marker)

    def test_a_purge_removes_the_file_of_the_service_alone(self):
        for marker in (self.SERVICE_FILE,) + self.OTHERS:
            self.assertEqual(self.after(marker, "postrm", "purge", installed=True), (marker != self.SERVICE_FILE, None), marker)


class Texts(unittest.TestCase):
    def test_manual_pages(self):
        pages = sorted(glob.glob(os.path.join(PACKAGING, "man", "*.[1-8]")))
        self.assertEqual(len(pages), 4)
        result = run("mandoc", "-Tlint", "-Wwarning", *pages)
        self.assertEqual((result.returncode, result.stdout + result.stderr), (0, ""))

    def test_every_message_with_an_id_is_in_the_catalog(self):
        with open(os.path.join(ROOT, "src", "linux", "LogSinks.cpp"), encoding="utf-8") as source:
            table = dict(re.findall(r'\{"([^"]+)",\s+"([0-9a-f]{32})"\}', source.read()))
        ids = list(table.values())
        with open(os.path.join(SYSTEMD, "tessel.catalog"), encoding="utf-8") as catalog:
            text = catalog.read()
        self.assertEqual(sorted(ids), sorted(re.findall(r"(?m)^-- ([0-9a-f]{32})$", text)))
        self.assertEqual(text.count("\nSubject: "), len(ids))
        warnings = []
        for path in glob.glob(os.path.join(ROOT, "src", "**", "*.cpp"), recursive=True):
            if not path.endswith("_test.cpp"):
                with open(path, encoding="utf-8") as source:
                    warnings += re.findall(r'\.warning\(\s*"([^"]+)', source.read())
        self.assertTrue(warnings)
        # "%@" alone stands for the texts of linux/Findings.cpp, which have a test beside them.
        self.assertEqual([text for text in warnings if not text.startswith((*table, "%@"))], [])

    def test_one_version_stands_everywhere(self):
        result = run(os.path.join(ROOT, "scripts", "release"), "--versions")
        self.assertEqual((result.returncode, result.stderr), (0, ""))

    def test_scripts(self):
        scripts = [path for kind in ("postinst", "prerm", "postrm") for path in glob.glob(os.path.join(ROOT, "debian", "*." + kind))]
        folders = [os.path.join(ROOT, name) for name in ("", ".ci", "scripts", "tests", "examples", "examples/fleet", "packaging")]
        for path in sorted(path for folder in folders for path in glob.glob(os.path.join(folder, "*"))):
            if os.path.isfile(path) and os.access(path, os.X_OK):
                with open(path, "rb") as script:
                    scripts += [path] if re.match(rb"#!/bin/(sh|bash)\b", script.readline()) else []
        self.assertIn(os.path.join(ROOT, ".ci", "run"), scripts)
        result = run("shellcheck", "--external-sources", "--source-path=" + ROOT, *scripts)
        self.assertEqual((result.returncode, result.stdout), (0, ""))


class Installed(unittest.TestCase):
    def test_what_is_installed_finds_its_programs(self):
        with tempfile.TemporaryDirectory() as root:
            environment = dict(os.environ, DESTDIR=root)
            result = run("cmake", "--install", os.environ["TESSEL_BUILD"], "--prefix", "/opt/tessel", env=environment)
            self.assertEqual(result.returncode, 0, result.stderr)
            self.assertEqual(os.listdir(root), ["opt"])
            prefix = os.path.join(root, "opt", "tessel")
            units = glob.glob(os.path.join(prefix, "lib", "systemd", "system", "*.service"))
            programs = [program for unit in units for program in settings(unit)["ExecStart"]]
            programs = [program.split()[0] for program in programs]
            self.assertGreaterEqual(len(programs), 1)
            for manual in glob.glob(os.path.join(prefix, "share", "man", "man8", "*.8")):
                with open(manual, encoding="utf-8") as page:
                    programs += re.findall(r"(?m)^\.Nm (/\S+)$", page.read())
            # The manual of tesselctl, which is in the PATH, names no path.
            self.assertEqual(len(programs), 2 * len(units) - 1)
            for program in programs:
                self.assertTrue(os.access(root + program, os.X_OK), program)


if __name__ == "__main__":
    unittest.main()
