#!/usr/bin/env python3
"""What tesselctl prints: on terminals of any width, in pipes, and with hostile texts."""
import contextlib
import datetime
import errno
import json
import os
import pty
import re
import resource
import signal
import sqlite3
import subprocess
import time

import harness
from harness import BIN, MachineTest, point

HOSTILE = ["\x1b[31mred", "\x1b]0;title\x07", "\u009b31m", "\u202eright-to-left", "%s%n%llu", "two\nlines", "tab\tand\rreturn",
           "\x7fdelete", "caf\udce9", "\u2028separator", "no\u200bwidth", "t\U000e0041g"]
# Characters that no recorded text may bring to a terminal. Line feeds are tested elsewhere.
OBEYED = re.compile("[\x00-\x09\x0b-\x1f\x7f-\x9f\u061c\u200e\u200f\u2028\u2029\u202a-\u202e\u200b\u2066-\u2069\U000e0041\udc80-\udcff]")
COLOUR = re.compile("\x1b\\[[0-9]{1,2}m")
EPOCH = datetime.datetime(1970, 1, 1, tzinfo=datetime.timezone.utc)
MICROSECOND = datetime.timedelta(microseconds=1)


def unescaped(text):
    """The recorded text that is shown as `text`; bytes that are not UTF-8 become what JSON has for them."""
    raw = re.sub(rb"\\x([0-9a-f]{2})", lambda found: bytes([int(found[1], 16)]), text.encode("utf-8", "surrogateescape"))
    return re.sub(r"\\(?:U([0-9a-f]{8})|u([0-9a-f]{4}))", lambda found: chr(int(found[1] or found[2], 16)), raw.decode("utf-8", "replace"))


def hostile_points():
    return [point("event", "com.vantor." + text, text, text, string1=(text, text), number1=(text, 1), at=-60 - i)
            for i, text in enumerate(HOSTILE)] + [point("event", "com.vantor.Fine", text, text) for text in HOSTILE]


class OutputTest(MachineTest):
    def spool(self):
        return os.path.join(self.machine.state, "statora.db")

    def add_rows(self, *rows):
        """Rows of any writer; each is a time, a name and a payload."""
        with contextlib.closing(sqlite3.connect(self.spool())) as database, database:
            database.executemany("INSERT INTO events(time, name, payload) VALUES(?, ?, ?)", rows)

    def on_terminal(self, *arguments, columns=80, **extra):
        """Runs the command on a terminal of this width; answers its output and its exit status."""
        leader, follower = pty.openpty()
        environment = self.machine.environment(**{"TERM": "xterm", **extra})
        script = f"stty cols {columns}; exec " + '"$0" "$@"'
        process = subprocess.Popen(["sh", "-c", script, os.path.join(BIN, "tesselctl"), *arguments], env=environment,
                                   stdin=follower, stdout=follower, stderr=subprocess.PIPE)
        os.close(follower)
        out = b""
        while True:
            try:
                part = os.read(leader, 65536)
            except OSError as error:
                if error.errno != errno.EIO:
                    raise
                break
            if not part:
                break
            out += part
        os.close(leader)
        process.communicate()
        return process.returncode, out.decode("utf-8", "surrogateescape").replace("\r\n", "\n")


class Terminals(OutputTest):
    def setUp(self):
        super().setUp()
        self.machine.write_export(hostile_points())
        self.assert_clean(self.machine.run())
        self.machine.now = time.time()

    COMMANDS = [("explain",), ("explain", "--payload"), ("explain", "--json", "--payload"), ("explain", "--summary"),
                ("explain", "--summary", "--json"), ("events",), ("events", "--json"), ("status",), ("status", "--json"),
                ("compare", "usual", "internal"), ("compare", "usual", "internal", "--json"), ("report", "--html", "-")]

    def test_nothing_that_a_terminal_obeys_comes_out(self):
        texts = [text.encode("utf-8", "surrogateescape").decode("latin-1") for text in HOSTILE]
        self.add_rows(*((int(time.time() * 1e6), text, json.dumps({text: text}, ensure_ascii=False)) for text in texts))
        self.add_rows(*((1, "bare", text) for text in texts))
        last = self.machine.ctl("events").out.count("\n")
        shown = [("events", "show", str(row), *json) for row in range(last - 2 * len(HOSTILE) + 1, last + 1)
                 for json in ((), ("--json",))]
        for arguments in self.COMMANDS + shown:
            result = self.machine.ctl(*arguments)
            self.assertEqual(result.status, 0, result.errors)
            # In a pipe the tabs between fields are ours. Fields hold none: each line has as many as its row has fields.
            found = OBEYED.search(result.out if "--json" in arguments else result.out.replace("\t", ""))
            self.assertIsNone(found, (arguments, found and result.out[max(0, found.start() - 60):found.end() + 20]))
            if "--json" in arguments:
                for line in result.out.splitlines():
                    json.loads(line)
        for text in ("\x1b[31mx", "\u009b"):
            result = self.machine.ctl("explain", "--store", "/nowhere/" + text, "--since", text)
            self.assertIsNone(OBEYED.search(result.errors), result.errors)

    def test_colours_are_for_terminals_that_want_them(self):
        for arguments in (("explain",), ("explain", "--summary"), ("status",), ("events",)):
            status, coloured = self.on_terminal(*arguments)
            self.assertEqual(status, 0)
            self.assertRegex(coloured, COLOUR)
            plain = COLOUR.sub("", coloured)
            self.assertNotIn("\x1b", plain)
            for refused in (dict(NO_COLOR="1"), dict(TERM="dumb")):
                self.assertNotIn("\x1b", self.on_terminal(*arguments, **refused)[1])
                self.assertRegex(self.on_terminal("--color", "always", *arguments, **refused)[1], COLOUR)
            self.assertNotIn("\x1b", self.on_terminal(*arguments, "--color=never")[1])
            in_pipe, painted = self.machine.ctl(*arguments).out, self.machine.ctl(*arguments, "--color=always").out
            self.assertRegex(painted, COLOUR)
            # Colours change no layout. A second may pass between the two.
            texts = [re.sub(r"\d+ s ago|[\d-]+ \d\d:\d\d:\d\d", "", text) for text in (in_pipe, COLOUR.sub("", painted))]
            self.assertEqual(*texts)
            self.assertNotIn("\x1b", in_pipe)
        for where in (("--color=maybe", "events"), ("events", "--color=maybe"), ("defer", "--color", "", "on")):
            result = self.machine.ctl(*where)
            self.assertEqual((result.status, result.out), (2, ""))
            self.assertRegex(result.errors, "--color.*auto.*always.*never")

    def test_listings_are_headed_by_date_and_zone(self):
        stamp = r"20\d\d-\d\d-\d\d \d\d:\d\d:\d\d"
        for zone, name in (("UTC", "UTC"), ("Asia/Tokyo", "JST")):
            for arguments in (("explain",), ("explain", "--summary")):
                head = self.on_terminal(*arguments, TZ=zone, NO_COLOR="1")[1].splitlines()[0]
                self.assertRegex(head, f"^{stamp} to {stamp} {name}$")
            head = self.on_terminal("events", "-n", "3", TZ=zone, NO_COLOR="1")[1].splitlines()
            self.assertRegex(head[0], f"^First row: {stamp} {name}$")
            self.assertRegex(head[1], r"^ *\d+  \d\d-\d\d ")
            period = f"{stamp} to {stamp} {name}"
            for arguments, head in ((("status",), f"{stamp} {name}\n"), (("compare", "usual", "internal"), f"{period}\nA: usual\nB: internal\n"),
                                    (("compare", "last=1h", "until=-1h"), f"A: last=1h, {period}\nB: until=-1h, {period}\n"),
                                    (("report", "--html", "-"), rf"[\s\S]*<p>{period} &middot;[\s\S]*made this page on {stamp} {name} ")):
                self.assertRegex(self.machine.ctl(*arguments, TZ=zone).out, "^" + head)

    def test_two_rows_of_a_repeated_hour_differ(self):
        instants = [1792888200 + 3600 * hour for hour in range(3)]  # 0:30, 1:30 and 2:30 UTC of October 25, 2026
        self.machine.now = instants[0]
        self.machine.write_export([point("event", "com.vantor.Clock", "Show", "Hand", at=at - instants[0]) for at in instants])
        self.add_rows(*((int(at * 1e6), "clock", "{}") for at in instants))
        berlin = {"TZ": "CET-1CEST,M3.5.0,M10.5.0/3", "NO_COLOR": "1"}
        for since in ("2026-10-25", "2026-10-25 01:00"):
            _, out = self.on_terminal("explain", "--since", since, "--until", "2026-10-25 04:00", **berlin)
            self.assertEqual(re.findall(r"(?m)^.*\b(0\d:30:00(?: \w+)?) +reported +event +com", out), ["02:30:00 CEST", "02:30:00 CET", "03:30:00"])
        self.assertRegex(self.on_terminal("events", "-n", "3", **berlin)[1], r"(?s) 02:30:00 CEST  waits .* 02:30:00 CET  waits .* 03:30:00  waits ")
        page = self.machine.ctl("report", "--since", "2026-10-25 01:00", "--until", "2026-10-25 05:00", "--html", "-", **berlin).out
        for column in ("10-25 02:30 CEST", "10-25 02:30 CET", "10-25 03:30"):
            self.assertIn(column + "<", page)

    def test_an_unknown_zone_is_said_once(self):
        commands = [("explain",), ("events",), ("status",), ("compare", "last=1h", "until=-1h"), ("report", "--html", "-")]
        for arguments in commands:
            result = self.machine.ctl(*arguments, TZ="Europe/Nowhere")
            self.assertEqual(result.errors.count("$TZ: 'Europe/Nowhere' is no time zone"), 1, result.errors)
            self.assertNotRegex(result.out, r"\d Europe\b")
        for zone in ("", "UTC", ":Asia/Tokyo", "/usr/share/zoneinfo/Asia/Tokyo", "CET-1CEST,M3.5.0,M10.5.0/3", "<+0330>-3:30"):
            self.assertNotIn("TZ", self.machine.ctl("explain", TZ=zone).errors, zone)

    def test_lines_fit_80_columns_and_the_terminal(self):
        for columns in (80, 60):
            for arguments in (("explain",), ("explain", "--summary"), ("status",), ("events",),
                              ("compare", "usual", "internal")):
                _, out = self.on_terminal(*arguments, columns=columns, NO_COLOR="1")
                for line in out.splitlines():
                    self.assertLessEqual(len(line), columns, (arguments, line))

        def body(*arguments, **options):  # the first line has the time of the call
            return self.on_terminal(*arguments, **options)[1].splitlines()[1:]

        usual = body("explain", "--summary")
        self.assertNotEqual(body("explain", "--summary", COLUMNS="60"), usual)
        for senseless in ("", "0", "-60", "60x", "6e1", " 60", "99999999999999999999", "10000"):
            self.assertEqual(body("explain", "--summary", COLUMNS=senseless), usual, senseless)
        self.assertEqual(body("explain", columns=0), body("explain", columns=80))


class Pipes(OutputTest):
    NAME = "Open" + "n" * 4000  # no table on a terminal shows it whole

    def setUp(self):
        super().setUp()
        self.machine.write_export(hostile_points() + [
            point("event", "com.vantor.Calendar", "View", f"Open{i}", string1=("period", "week"), at=-90 - i) for i in range(21)] + [
            point("event", "com.vantor.Calendar", "View", self.NAME, string1=("period", "weekly " * 500)),
            point("event", "com.vantor.Calendar", "View", None)])
        self.assert_clean(self.machine.run())

    def lines(self, *arguments, **extra):
        return self.assert_clean(self.machine.ctl(*arguments, **extra)).out.splitlines()

    def objects(self, *arguments):
        return [json.loads(line) for line in self.lines(*arguments, "--json")]

    def test_a_record_is_one_whole_line(self):
        explained = self.objects("explain", "--payload")
        for columns in ("", "40"):
            lines = [line.split("\t") for line in self.lines("explain", "--payload", COLUMNS=columns, TZ="America/St_Johns")]
            self.assertEqual(len(lines), len(explained))
            for line, one in zip(lines, explained):
                stamp = datetime.datetime.fromisoformat(line[0])
                self.assertEqual(((stamp - EPOCH) // MICROSECOND, stamp.utcoffset() != EPOCH.utcoffset()), (one["time"], True))
                self.assertEqual([line[1], line[2], *map(unescaped, line[3:6])],
                                 [one["verdict"], one["kind"].lower(), one["subsystem"], one["category"], one.get("name", "")])
                self.assertEqual(("whitelist" in line[1]), unescaped(one.get("rule", {}).get("value", "\t")) in unescaped(line[6]))
                self.assertEqual(json.loads(line[-1]) if line[-1] else None, one.get("payload"))
        stamps = sorted(line[0] for line in lines)  # --since takes the time as it is printed
        for stamp in (stamps[0], stamps[-1]):
            self.assertEqual(len(self.lines("explain", "--since", stamp)), sum(stamp <= other for other in stamps))

        rows = self.objects("events")
        lines = [line.split("\t") for line in self.lines("events")]
        self.assertEqual([(line[0], unescaped(line[2])) for line in lines], [(str(row["id"]), row["name"]) for row in rows])
        self.assertEqual({len(line) for line in lines}, {6})
        self.assertEqual(sum("week" in line for line in self.lines("events")), 42)
        for line, row in zip(lines, rows):
            for key, value in row["payload"].items():
                if key not in ("Subsystem", "Category", "Name"):
                    self.assertIn(f"{key}={value}" if isinstance(value, str) else f"{key}=", unescaped(line[5]))

    def test_tables_are_lines_of_fields(self):
        summary = self.objects("explain", "--summary")[0]
        lines = self.lines("explain", "--summary")
        for pair in summary["pairs"]:  # more than a terminal shows
            [line] = [line for line in lines if unescaped(line).startswith(f"{pair['subsystem']}\t{pair['category']}\t")]
            self.assertEqual(line.split("\t")[2], str(pair["reported"]))
        self.assertGreater(len(summary["whitelist_misses"]), 20 - len(HOSTILE))
        for miss in summary["whitelist_misses"]:
            self.assertTrue([line for line in map(unescaped, lines) if line.startswith(f"{miss['count']}\t\"{miss['value']}\"\t")])
        compared = self.objects("compare", "usual", "internal")[0]
        lines = [line for line in self.lines("compare", "usual", "internal") if line.startswith("starts\t")]
        self.assertEqual(len(lines), len(compared["changes"]))
        self.assertTrue([line for line in lines if self.NAME in line])

    def test_events_show_has_all_of_a_row(self):
        exact = '{"a":{"deep":[1.50,18446744073709551616,{}],"a":[]},"a":"\\"[,]{:}\\\\","e":"\u202e"}'
        self.add_rows((1, "exact", exact), (2, "text", "{no json\x1b[31m"))
        last = self.objects("events", "-n", "2")
        self.assertEqual(self.objects("events", "show", str(last[0]["id"])), last[:1])
        out = self.assert_clean(self.machine.ctl("events", "show", str(last[0]["id"]))).out
        head, payload = out.split("{", 1)
        self.assertEqual(head.split(), ["Id", str(last[0]["id"]), "Time", "1970-01-01T00:00:00.000001+00:00", "Name", "exact"])
        self.assertEqual(re.sub(r"\n *|(?<=:) ", "", "{" + payload), exact.replace("\u202e", "\\u202e"))
        self.assertIn('\n  "a": {\n    "deep": [\n      1.50,\n', out)
        self.assertIn("{no json\\x1b[31m", self.machine.ctl("events", "show", str(last[1]["id"])).out)
        self.add_rows((3, "deep", "[" * 100_000 + "]" * 100_000))
        deep = last[1]["id"] + 1
        self.assertLess(len(self.assert_clean(self.machine.ctl("events", "show", str(deep))).out), 30_000_000)
        for word, status, said in ((str(deep + 1), 1, f"ids go from 1 to {deep}"), ("0", 2, "'0'"), ("0100000", 1, "row 100000"),
                                   ("-1", 2, "-1"), ("1x", 2, "'1x'"), ("99999999999999999999", 2, "'9999"), ("", 2, "''")):
            result = self.machine.ctl("events", "show", word)
            self.assertEqual((result.status, result.out, result.errors.count("\n")), (status, "", 1), (word, result.errors))
            self.assertIn(said, result.errors)
        self.assertEqual(self.machine.ctl("events", "show", "1", "-n", "2").status, 2)

    PRINTING = [*Terminals.COMMANDS, ("events", "show", "1"), ("tasking", "show"), ("tasking", "show", "--json"), ("defer", "on"),
                ("defer", "off", "--json"), ("--help",), ("explain", "--help"), ("--version",), ("events", "--follow")]

    def run_to(self, output, arguments, **options):
        return subprocess.run([os.path.join(BIN, "tesselctl"), *arguments], env=self.machine.environment(), stdout=output,
                              stderr=subprocess.PIPE, text=True, check=False, timeout=60, **options)

    def test_output_that_is_not_taken_is_an_error(self):
        with open("/dev/full", "wb") as full:
            for arguments in self.PRINTING:
                result = self.run_to(full, arguments)
                self.assertEqual((result.returncode, result.stderr.count("\n")), (1, 1), (arguments, result.stderr))
                self.assertRegex(result.stderr, "^tesselctl: standard output: No space left on device$")
        closed = self.run_to(None, ("defer", "on"), preexec_fn=lambda: os.close(1))
        self.assertEqual((closed.returncode, closed.stderr), (1, "tesselctl: standard output: Bad file descriptor\n"))
        with open(os.path.join(self.machine.root, "limited"), "wb") as file:
            limited = self.run_to(file, ("explain",), preexec_fn=lambda: resource.setrlimit(resource.RLIMIT_FSIZE, (4096, 4096)))
        self.assertEqual((limited.returncode, limited.stderr), (1, "tesselctl: standard output: File too large\n"))

    def test_a_reader_may_leave_early(self):
        for arguments in (("events",), ("events", "--json"), ("explain",), ("explain", "--summary", "--json")):
            for handler, status in ((signal.SIG_DFL, -signal.SIGPIPE), (signal.SIG_IGN, 1)):
                reader, writer = os.pipe()
                os.close(reader)
                with open(writer, "wb") as pipe:
                    result = self.run_to(pipe, arguments, restore_signals=False, preexec_fn=lambda: signal.signal(signal.SIGPIPE, handler))
                self.assertEqual((result.returncode, result.stderr), (status, ""), arguments)

    def test_following_ends_with_its_reader(self):
        for arguments in (("events", "--follow"), ("explain", "--follow")):
            reader, writer = os.pipe()
            with open(reader, "rb") as lines, open(writer, "wb") as pipe, subprocess.Popen(
                    [os.path.join(BIN, "tesselctl"), *arguments], env=self.machine.environment(), stdout=pipe,
                    stderr=subprocess.PIPE) as process:
                pipe.close()
                if arguments[0] == "events":
                    self.assertTrue(lines.readline())
                lines.close()
                try:
                    self.assertEqual(process.communicate(timeout=20)[1], b"")
                finally:
                    process.kill()

    def test_programs_tell_their_version(self):
        for program in ("tesselctl", "statora_forwarder"):
            result = self.machine.result(self.machine.start(program, "--version"))
            self.assertRegex(self.assert_clean(result).out, rf"^{program} \d+\.\d+\.\d+\n$")


if __name__ == "__main__":
    harness.main()
