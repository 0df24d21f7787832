#!/usr/bin/env python3
"""The command line of tesselctl: what the completion offers, what messages name, and a store on standard input."""
import json
import os
import pty
import re
import select
import subprocess
import time

import harness
from harness import BIN, MachineTest, export_bytes, log_event, point
from status_case import CODES

SCRIPT = os.path.join(os.path.dirname(os.path.abspath(__file__)), "../packaging/completion/tesselctl")
# What the shell does at a press of the key: the framework of Debian, and the function for the program.
PRESS = """. /usr/share/bash-completion/bash_completion; . "$0"
COMP_LINE="$*"; COMP_POINT=${#COMP_LINE}; COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1)); COMP_TYPE=9; COMP_KEY=9
_tesselctl; printf '%s\\n' "${COMPREPLY[@]}"
"""
VERDICTS = ["reported", "telemetry_disabled", "string_whitelist", "duration", "downsampled", "class_not_supported"]
COMMANDS = {"record": ["event", "begin", "end"], "explain": [], "compare": [], "events": ["show"], "status": [], "rules": ["check"],
            "defer": ["on", "off"], "tasking": ["on", "off", "show"], "report": []}


class Completion(MachineTest):
    def offered(self, *words):
        result = subprocess.run(["bash", "-c", PRESS, SCRIPT, "tesselctl", *words], capture_output=True, text=True, check=False,
                                env=self.machine.environment(LC_ALL="C", PATH=BIN + ":" + os.environ["PATH"]), cwd=self.machine.root)
        self.assertEqual(result.stderr, "")
        return sorted(result.stdout.split())

    def test_it_offers_what_the_help_names(self):
        self.assertEqual(self.offered(""), sorted(COMMANDS))
        for command, positions in COMMANDS.items():
            for path in [(command,)] + [(command, position) for position in positions]:
                text = self.machine.ctl(*path, "--help").out
                named = re.findall(r"^  (?:-\w,)?(--[a-z0-9-]+)", text, re.M)
                offered = self.offered(*path, "--")
                if len(path) == 1:
                    self.assertEqual(offered, sorted(set(named)), path)
                self.assertLessEqual(set(named), set(offered), path)
                self.addCleanup(lambda: os.path.exists("--none") and os.unlink("--none"))  # of --prometheus
                for option in offered:  # a missing value is complained of, and the word behind it, but never the option
                    self.assertNotRegex(self.machine.ctl(*path, option, "--none").errors, f"expected: .*{option}", (path, option))
        self.assertEqual(self.offered("events", "show", "--"), ["--color", "--help", "--json"])
        self.assertEqual(self.offered("events", "--j"), ["--json"])
        self.assertEqual(self.offered("events", "--json", "--j"), [])

    def test_it_offers_the_values_that_are_taken(self):
        platforms = ["Darrow", "Fennic", "Lumet", "Quarro", "Selvin"]
        with open(os.path.join(self.machine.root, "a file"), "w", encoding="utf-8"):
            pass
        for words, wanted in ((["--color", ""], ["always", "auto", "never"]), (["--color=a"], ["always", "auto"]),
                              (["--color", "always", "ev"], ["events"]), (["explain", "--platform", ""], platforms),
                              (["explain", "--verdict", "d"], ["downsampled", "duration"]),
                              (["record", "begin", "--scope", ""], ["process", "system"]), (["defer", ""], ["off", "on"]),
                              (["defer", "on", ""], []), (["tasking", "s"], ["show"]), (["compare", "usual", "S"], ["Selvin"]),
                              (["compare", "since"], ["since="]), (["compare", "usual", "usual", ""], []),
                              (["explain", "--since", ""], []), (["nonsense", "--"], ["--color", "--help", "--version"])):
            self.assertEqual(self.offered(*words), wanted, words)
        for words in (["explain", "--store", "a"], ["report", "--html", "a"]):
            self.assertEqual(" ".join(self.offered(*words)), "a file", words)


class Help(MachineTest):
    TOLD = {"record": ["4 it could not be handed", "process that records is tesselctl"], "explain": VERDICTS + ["process, its id, its user"],
            "compare": ["few_values", "needs 11", "not_recorded"], "events": ["id, time, name, time of delivery, destination, payload"],
            "rules": ["PLATFORM, list, value"], "status": CODES + ["over_share", "exit status", "4 if this user"], "defer": [], "tasking": ["TaskedOn"], "report": []}

    def test_each_answers_alone(self):
        texts = {command: self.assert_clean(self.machine.ctl(*command.split(), "--help")).out for command in ["", "rules check", *self.TOLD]}
        for command, text in texts.items():
            self.assertEqual([line for line in text.splitlines() if len(line) > 80], [], command)
            for told in ["tesselctl " + command, *self.TOLD.get(command, [])]:
                self.assertRegex(re.sub(r"\s+", " ", text), "(?i)" + re.escape(told))
            self.assertIn("Example" if command else "Environment", text)
        with open(os.path.join(os.path.dirname(SCRIPT), "../man/tesselctl.1"), encoding="utf-8") as file:
            manual = set(re.findall(r"\bTESSEL_[A-Z_]+|\bTZ\b|NO_COLOR|COLUMNS", file.read().split(".Sh ENVIRONMENT")[1].split(".Sh ")[0]))
        self.assertEqual(set(re.findall(r"(?m)^  (TESSEL_\w+|TZ|NO_COLOR|COLUMNS) ", "".join(texts.values()))), manual)


class Messages(MachineTest):
    """Bad input through every command. (arguments, what the one line on stderr says.)"""
    USAGE = (
        ((), "needs one of record, explain"), (("evens",), "no command 'evens'.*record, explain, compare, events"), (("--nope",), "'--nope'.*--version"),
        (("--color", "blue", "status"), "--color: 'blue'.*auto, always, never"), (("status", "--color"), "--color needs one of auto, always, never"),
        (("status", "--store", "X"), "status has no option '--store'; it has .*--json"), (("status", "x"), "status takes no word: 'x'"),
        (("explain", "--json=no"), "--json takes no value"), (("explain", "x"), "explain takes no word: 'x'"),
        (("explain", "--platform", "quarro"), "--platform: 'quarro'.*Quarro, Selvin"), (("explain", "--platform"), "--platform needs one of Quarro"),
        (("rules", "--platform", "Quarro", "--platform", "Selvin"), "--platform may stand once"),
        (("explain", "--verdict", "good"), "--verdict: 'good'.*reported, .*downsampled"), (("explain", "--internal", "--no-internal"), "cannot stand with"),
        (("explain", "--store"), "--store needs a value, PATH: .*export"), (("explain", "--store", ""), "--store: '' names no file"),
        (("explain", "--last", "5"), "--last: '5'.*30m, 24h"), (("explain", "--last", ""), "--last: ''.*30m"), (("report", "--html", "-", "--last"), "30m, 24h"),
        (("explain", "--since", "2026-02-30"), "--since: '2026-02-30'.*2026-11-22"), (("explain", "--since", ""), "--since: ''.*2026-11-22"),
        (("explain", "--until", "22:00 CTE"), "--until: .*'CTE'.*Europe/Berlin"), (("explain", "--since", "-1h", "--last", "1h"), "--last"),
        (("explain", "--since", "tomorrow"), "empty period"), (("explain", "--follow", "--summary"), "--follow"),
        (("explain", "--summary", "--payload"), "--payload"), (("compare",), "compare needs A B; A is missing: .*usual, internal"),
        (("compare", "usual", "unusual"), "'unusual'.*usual, internal.*last=DURATION"), (("compare", "usual", ""), "''.*usual, internal"),
        (("compare", "usual", "last=x"), "last=x.*'x'.*30m"), (("compare", "usual", "since="), "''.*2026-11-22"),
        (("compare", "usual", "Selvin,Quarro"), "'Quarro' contradicts"), (("compare", "usual", "internal,no-internal"), "'no-internal' contradicts"),
        (("events", "-n", "0"), "--newest: '0'.*rows from 1 to"), (("events", "-n", "9" * 20), "'9+'.*rows from 1 to"), (("events", "-n"), "--newest.*COUNT"),
        (("events", "--store", "X"), "events has no option '--store'"), (("events", "--sent", "--waiting"), "cannot stand with"),
        (("events", "42"), "takes show: tesselctl events show 42"), (("events", "show"), "events show needs ID.*id of the row"),
        (("events", "show", "1", "-n", "2"), "events show has no option '-n'"), (("events", "show", "1x"), "'1x' is no id.*from 1"),
        (("rules", "Calendar"), "takes check: tesselctl rules check Calendar"), (("rules", "check"), "rules check needs.*VALUE"),
        (("rules", "check", "a", "b"), "one VALUE, or SUBSYSTEM CATEGORY NAME"),
        (("rules", "check", "a", "b", "c", "--string1", "x"), "--string1: 'x' is not LABEL=VALUE"), (("rules", "--markdown", "--json"), "--markdown"),
        (("defer",), "defer needs one of on, off"), (("defer", "up"), "'up'.*on, off"), (("defer", "on", "off"), "defer on takes no word: 'off'"),
        (("tasking",), "on, off, show"), (("tasking", "maybe"), "'maybe'.*on, off, show"), (("report",), "report needs --html FILE"),
        (("report", "--html", ""), "--html: ''"), (("report", "--html", "-", "--last-run", "--last", "1h"), "--last-run"),
        (("record",), "event, begin or end, --stdin"), (("record", "event", "a"), "SUBSYSTEM CATEGORY \\[NAME\\]; category is missing"),
        (("record", "event", "a", "b", "c", "d"), "takes no word behind SUBSYSTEM CATEGORY .*'d'"), (("record", "frob"), "'frob'.*event, begin, end"),
        (("record", "event", "", "b"), "TESSEL_SUBSYSTEM is empty"), (("record", "event", "a", "b", "--scope", "all"), "--scope: 'all'.*process, system"),
        (("record", "event", "a", "b", "--number1", "n=1e999"), "'1e999' is not a decimal number"), (("record", "event", "a", "b", "--field", "_X=1"), "capital letters"),
        (("record", "event", "a", "b", "--at", "5"), "--at needs --store"), (("record", "event", "a", "b", "--store", ""), "--store: ''"),
        *((("record", "event", "a", "b", "--store", ".", *bad), said) for bad, said in (
            (("--at", "-1"), "--at: '-1'.*microseconds from 0"), (("--ago", "x"), "--ago: 'x'.*seconds from 0 to 1000000000;"),
            (("--ago", "1e30"), "--ago: '1e30'"), (("--ago", "999999999"), "before this machine's boot: give --boot"),
            (("--boot", "x"), "--boot: 'x'.*32 hexadecimal"), (("--pid", "x"), "--pid: 'x'.*digits"))))
    VARIABLES = (("TESSEL_DEFER_RETRY", "soon", "from 1 to"), ("TESSEL_DEFER_ON", "x", "file, battery, pressure"), ("TESSEL_SPOOL_LIMIT", "-1", "from 4194304 to"),
                 ("TESSEL_LOG", "x", "journal or stderr"), ("TESSEL_STATE_DIR", "", "expected a path"))

    def assert_said(self, result, status, said, what):
        self.assertEqual((result.status, result.out, result.errors.count("\n")), (status, "", 1), (what, result.errors))
        self.assertRegex(result.errors, f"^tesselctl: .*(?:{said})")

    def test_what_makes_no_sense_is_named(self):
        self.machine.write_export([log_event("x")])
        for arguments, said in self.USAGE:
            self.assert_said(self.machine.ctl(*arguments), 2, said, arguments)
        for variable, value, said in self.VARIABLES:
            self.assert_said(self.machine.ctl("events", **{variable: value}), 2, f'{variable}="{value}".*{said}', variable)

    def test_what_cannot_be_done_is_named(self):
        machine, path = self.machine, lambda name: os.path.join(self.machine.root, name)
        for name in ("folder", "spool_of_folder/statora.db", "bent/" + harness.TASKING):
            os.makedirs(path(name))
        os.mkdir(path("text"))
        for name, text in (("file", ""), ("words.journal", "hello"), ("text/" + harness.TASKING, "nonsense"), ("text/statora.db", "text")):
            with open(path(name), "w", encoding="utf-8") as file:
                file.write(text)
        stores = ("/nowhere/Permission denied", "No such file"), (path("folder"), "holds no"), (path("file"), "empty"), ("/dev/null", "neither"), (path("words.journal"), "short")
        rows = [((*command, "--store", store), {}, f"{store}: .*{said}.*a directory with ") for store, said in stores
                for command in (("explain",), ("compare", "usual", "internal"), ("report", "--html", "-"))]
        rows += [
            (("explain",), {"TESSEL_TRACE_STORE": "/nowhere"}, "/nowhere: No such"), (("events", "show", "1"), {}, "no spool at " + machine.state),
            (("events",), {"TESSEL_STATE_DIR": path("file")}, f"{path('file')} is no directory; TESSEL_STATE_DIR"),
            (("events",), {"TESSEL_STATE_DIR": path("spool_of_folder")}, "statora.db is a directory"), (("events",), {"TESSEL_STATE_DIR": path("text")}, "damaged: .*sets it aside"),
            (("defer", "on"), {"TESSEL_STATE_DIR": "/nowhere"}, "/nowhere/defer"), (("defer", "off"), {"TESSEL_STATE_DIR": path("file")}, "Not a directory"),
            (("tasking", "on"), {"TESSEL_CONFIG_DIR": path("file")}, "Not a directory"), (("tasking", "on"), {"TESSEL_CONFIG_DIR": path("bent")}, "no regular file"),
            (("tasking", "off"), {"TESSEL_CONFIG_DIR": path("text")}, "no JSON object.*correct or remove"), (("report", "--html", path("folder")), {}, "Is a directory"),
            (("report", "--html", "/nowhere/x"), {}, "/nowhere/x: No such"), (("report", "--html", "-", "--last-run"), {}, "no record of a run in " + machine.state)]
        machine.write_export([log_event("x")])
        for arguments, variables, said in rows:
            self.assert_said(machine.ctl(*arguments, **variables), 1, said, arguments)

    def test_nothing_sent_is_an_answer(self):
        for arguments in (("events",), ("events", "--json"), ("events", "--sent")):
            result = self.machine.ctl(*arguments)
            self.assertEqual((result.status, result.out, result.errors.count("\n")), (0, "", 1), result.errors)
            self.assertIn("Nothing was reported", result.errors)


class Dates(MachineTest):
    def test_what_journalctl_prints_is_taken(self):
        path = self.machine.write_journal([point("event", "com.vantor.A", "B", at=at) for at in (-600, -300)])
        day, clock = r"20\d\d-\d\d-\d\d", r"\d\d:\d\d:\d\d"
        for zone in ("Europe/Berlin", "America/St_Johns"):
            for form, date in (("short", rf"\w+ \d+ {clock}"), ("short-precise", rf"\w+ \d+ {clock}\.\d+"), ("short-full", rf"\w+ {day} {clock} \w+"),
                               ("with-unit", rf"\w+ {day} {clock} \w+"), ("short-iso", rf"{day}T{clock}[+-][\d:]+"), ("verbose", rf"\w+ {day} {clock}\.\d+ \w+"),
                               ("short-iso-precise", rf"{day}T{clock}\.\d+[+-][\d:]+"), ("short-unix", r"\d+\.\d+")):
                printed = subprocess.run(["journalctl", "--file", path, "-q", "-o", form], capture_output=True, text=True, check=True,
                                         env={**os.environ, "TZ": zone, "LC_ALL": "C"}).stdout
                dates = re.findall(rf"(?m)^{date}(?= )", printed)
                self.assertEqual(len(dates), 2, (form, printed))
                for shown, since in zip((2, 1), dates):
                    result = self.assert_clean(self.machine.ctl("explain", "--since", since, TZ=zone))
                    self.assertEqual(len(result.out.splitlines()), shown, (zone, form, since))


class StandardInput(MachineTest):
    def stream(self, count=3, at=-60):
        return b"".join(export_bytes([point("event", "com.vantor.A", "B", f"Point{i}", at=at + i / 1000) for i in range(count)], self.machine.now))

    def read(self, data, *arguments):
        return subprocess.run([os.path.join(BIN, "tesselctl"), *arguments, "--store", "-"], input=data, capture_output=True, check=False,
                              env=self.machine.environment(), timeout=60)

    def test_a_stream_is_a_store(self):
        stream = self.stream()
        self.machine.write_export([point("event", "com.vantor.A", "B", f"Point{i}", at=-60 + i / 1000) for i in range(3)])
        for arguments in (("explain",), ("explain", "--json"), ("compare", "usual", "internal"), ("compare", "usual", "internal", "--json")):
            result = self.read(stream, *arguments)
            self.assertEqual((result.returncode, result.stderr), (0, b""), arguments)
            texts = [re.sub(r"[\d-]+ \d\d:\d\d:\d\d|\"(since|until)\":\d+", "", text)  # the period moves with the clock
                     for text in (result.stdout.decode(), self.machine.ctl(*arguments).out)]
            self.assertEqual(*texts)
        summary = json.loads(self.read(stream, "explain", "--summary", "--json").stdout)
        self.assertEqual((summary["trace_objects"], summary["files"][0]["path"]), (3, "standard input"))
        self.assertIn(b"standard input", self.read(stream, "report", "--html", "-").stdout)
        self.assertEqual((self.read(b"", "explain").returncode, self.read(b"", "explain").stdout), (0, b""))

    def test_a_broken_stream_is_named_with_its_place(self):
        stream = self.stream()
        for arguments in (("explain",), ("explain", "--summary"), ("compare", "usual", "internal"), ("report", "--html", "-")):
            result = self.read(stream + b"no field\n\n" + self.stream(1), *arguments)
            self.assertEqual(result.returncode, 1)
            self.assertRegex(result.stderr.decode(), f"^tesselctl: standard input is broken in 1 place, first at byte {len(stream)}: [a-z ]+\n$")
            self.assertTrue(result.stdout)
        cut = self.read(stream[:-9], "explain")
        self.assertEqual((cut.returncode, cut.stdout.count(b"\n")), (1, 2))
        self.assertIn(b"incomplete last entry", cut.stderr)
        self.assertIn(b"journalctl -o export", self.read(b"Nov 22 21:45:30 machine program: text\n", "explain").stderr)

    def test_what_cannot_be_read_from_it_is_said(self):
        for arguments, said in ((("explain", "--follow"), b"--follow"), (("compare", "since=-2d,until=-1d", "last=1d"), b"read once")):
            result = self.read(self.stream(), *arguments)
            self.assertEqual((result.returncode, result.stdout), (2, b""))
            self.assertIn(said, result.stderr)
        result = self.machine.ctl("explain", TESSEL_TRACE_STORE="-")  # to the service that is a directory
        self.assertEqual((result.status, "./-: No such file" in result.errors), (1, True), result.errors)

    def test_progress_counts_from_the_oldest_entry(self):
        leader, follower = pty.openpty()
        self.addCleanup(os.close, leader)
        process = subprocess.Popen([os.path.join(BIN, "tesselctl"), "explain", "--summary", "--last", "7d", "--store", "-"],
                                   env=self.machine.environment(TERM="xterm"), stdin=subprocess.PIPE, stdout=subprocess.DEVNULL, stderr=follower)
        os.close(follower)
        shown, count = b"", 0
        deadline = time.monotonic() + 60
        while b"%" not in shown and time.monotonic() < deadline:
            # Entries from an hour ago on: of a week that is the last 0.6 %, of the store the beginning.
            entries = [log_event("x", at=-3600 + (count + i) / 1e4) for i in range(500)]
            process.stdin.write(b"".join(export_bytes(entries, self.machine.now, first_sequence=count + 1)))
            process.stdin.flush()
            count += len(entries)
            while select.select([leader], [], [], 0.02)[0] and b"%" not in shown:
                shown += os.read(leader, 4096)
        process.stdin.close()
        process.wait(30)
        self.assertLess(int(re.search(rb"(\d+) ?%", shown)[1]), 5, shown)


if __name__ == "__main__":
    harness.main()
