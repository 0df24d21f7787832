#!/usr/bin/env python3
"""What tesselctl prints: on terminals of any width, in pipes, and with hostile texts."""
import contextlib
import errno
import json
import os
import pty
import re
import sqlite3
import subprocess
import time

import harness
from harness import BIN, MachineTest, point

HOSTILE = ["\x1b[31mred", "\x1b]0;title\x07", "\u009b31m", "\u202eright-to-left", "%s%n%llu", "two\nlines", "tab\tand\rreturn",
           "\x7fdelete", "caf\udce9", "\u2028separator"]
# Control characters that no recorded text may bring to a terminal. Line feeds are tested elsewhere.
OBEYED = re.compile("[\x00-\x09\x0b-\x1f\x7f-\x9f\u061c\u200e\u200f\u2028\u2029\u202a-\u202e\u2066-\u2069\udc80-\udcff]")
COLOUR = re.compile("\x1b\\[[0-9]{1,2}m")


def hostile_points():
    return [point("event", "com.vantor." + text, text, text, string1=(text, text), number1=(text, 1), at=-60 - i)
            for i, text in enumerate(HOSTILE)] + [point("event", "com.vantor.Fine", text, text) for text in HOSTILE]


class Terminals(MachineTest):
    def spool(self):
        return os.path.join(self.machine.state, "statora.db")

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

    def setUp(self):
        super().setUp()
        self.machine.write_export(hostile_points())
        self.assert_clean(self.machine.run())
        self.machine.now = time.time()

    COMMANDS = [("explain",), ("explain", "--payload"), ("explain", "--json", "--payload"), ("explain", "--summary"),
                ("explain", "--summary", "--json"), ("events",), ("events", "--json"), ("status",), ("status", "--json"),
                ("compare", "usual", "internal"), ("compare", "usual", "internal", "--json"), ("report", "--html", "-")]

    def test_nothing_that_a_terminal_obeys_comes_out(self):
        with contextlib.closing(sqlite3.connect(self.spool())) as database, database:
            for text in HOSTILE:
                text = text.encode("utf-8", "surrogateescape").decode("latin-1")
                database.execute("INSERT INTO events(time, name, payload) VALUES(?, ?, ?)",
                                 (int(time.time() * 1e6), text, json.dumps({text: text}, ensure_ascii=False)))
                database.execute("INSERT INTO events(time, name, payload) VALUES(1, 'bare', ?)", (text,))
        for arguments in self.COMMANDS:
            result = self.machine.ctl(*arguments)
            self.assertEqual(result.status, 0, result.errors)
            found = OBEYED.search(result.out)
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
            self.assertNotIn("\x1b", self.machine.ctl(*arguments).out)

    def test_lines_fit_80_columns_and_the_terminal(self):
        for columns in (80, 60):
            for arguments in (("explain",), ("explain", "--summary"), ("status",), ("events",),
                              ("compare", "usual", "internal")):
                _, out = self.on_terminal(*arguments, columns=columns, NO_COLOR="1")
                for line in out.splitlines():
                    self.assertLessEqual(len(line), columns, (arguments, line))
        for line in self.machine.ctl("explain").out.splitlines():
            self.assertLessEqual(len(line), 80)


if __name__ == "__main__":
    harness.main()
