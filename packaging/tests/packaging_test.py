#!/usr/bin/env python3
"""Checks units, manual pages, completion, catalog and scripts without installing them."""

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

    def test_verify(self):
        with tempfile.TemporaryDirectory() as directory:
            # The programs and their users are not installed here: stand-ins take their place.
            for path in (REPORTER, FORWARDER, TIMER):
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
        self.assertNotIn("pid", unit.get("ProcSubset", []))
        with open(os.path.join(SYSTEMD, "tessel-reporter.tmpfiles"), encoding="utf-8") as lines:
            self.assertIn("x", [line.split()[0] for line in lines
                                if "/var/tmp/tessel_reporter_running" in line])

    def test_life_of_the_service(self):
        unit = settings(REPORTER)
        for setting, value in {"Type": "notify", "KillSignal": "SIGINT", "PrivateNetwork": "yes",
                               "User": "tessel-reporter", "SupplementaryGroups": "systemd-journal",
                               "StateDirectory": "tessel", "ConfigurationDirectory": "tessel",
                               "MemoryMax": "128M"}.items():
            self.assertEqual(unit.get(setting), [value], setting)
        self.assertIn("WatchdogSec", unit)

    def test_the_timer_keeps_its_distance(self):
        timer = settings(TIMER)
        for setting, value in {"OnCalendar": "daily", "RandomizedDelaySec": "6h",
                               "FixedRandomDelay": "true", "AccuracySec": "1min",
                               "Persistent": "true"}.items():
            self.assertEqual(timer.get(setting), [value], setting)

    def test_the_forwarder_waits_for_an_endpoint(self):
        unit = settings(FORWARDER)
        self.assertIn("/etc/statora/forwarder.env", unit["ConditionPathExists"])
        self.assertNotEqual(unit["User"], settings(REPORTER)["User"])
        with open(os.path.join(PACKAGING, "debian", "statora-forwarder.postinst"), encoding="utf-8") as script:
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
        self.assertEqual([text for text in warnings if not text.startswith(tuple(table))], [])

    def test_completion(self):
        script = os.path.join(PACKAGING, "completion", "tesselctl")
        offered = {}
        for words in ("tesselctl ", "tesselctl defer ", "tesselctl tasking s"):
            # Stands in for the framework's own function.
            line = ("_init_completion() { words=(%s); cword=$((${#words[@]} - 1)); cur=${words[cword]};"
                    " prev=${words[cword-1]}; }; . '%s'; _tesselctl; echo \"${COMPREPLY[@]}\"")
            array = " ".join("'%s'" % word for word in words.split(" "))
            result = run("bash", "-c", line % (array, script))
            self.assertEqual(result.stderr, "")
            offered[words] = result.stdout.split()
        self.assertIn("explain", offered["tesselctl "])
        self.assertEqual(offered["tesselctl defer "], ["on", "off"])
        self.assertEqual(offered["tesselctl tasking s"], ["show"])

    def test_scripts(self):
        scripts = glob.glob(os.path.join(PACKAGING, "debian", "*.p*"))
        folders = [os.path.join(ROOT, name) for name in ("", ".ci", "scripts", "tests", "examples", "packaging")]
        for path in sorted(path for folder in folders for path in glob.glob(os.path.join(folder, "*"))):
            if os.path.isfile(path) and os.access(path, os.X_OK):
                with open(path, "rb") as script:
                    scripts += [path] if re.match(rb"#!/bin/(sh|bash)\b", script.readline()) else []
        self.assertIn(os.path.join(ROOT, ".ci", "run"), scripts)
        result = run("shellcheck", *scripts)
        self.assertEqual((result.returncode, result.stdout), (0, ""))


if __name__ == "__main__":
    unittest.main()
