#!/usr/bin/env python3
"""One table of trace points, recorded from every language beside a live journal daemon.

The runners of conformance/ read a line for each action and answer with its errno value; the shell is
`tesselctl record --stdin`, which reads JSON. Whatever the language, the entries must be the same.
"""
import errno
import fcntl
import os
import re
import signal
import subprocess
import sys
import tempfile
import termios
import time
import unittest

import harness
from conformance_cases import CASES, LARGE, OVER, UNSAYABLE, fields, json_line, line, parsed, point, read_back
from harness import BIN

HERE = os.path.dirname(os.path.abspath(__file__))
ROOT = os.path.dirname(HERE)
RUNNERS = {name: [os.path.join(BIN, "conformance_" + name)] for name in ("c", "cpp", "go", "rust")}
RUNNERS["python"] = ["/usr/bin/python3", os.path.join(HERE, "conformance", "runner.py")]
SHELL = [os.path.join(BIN, "tesselctl"), "record", "--stdin"]
# A system call could change the limits of these tests, a variable of the caller what is recorded.
CLEAN = {"PATH": "/usr/bin:/bin", "PYTHONPATH": os.path.join(ROOT, "bindings", "python"), "PYTHONDONTWRITEBYTECODE": "1"}
BURST, BAR = 1_000, 10_000


def journal(pid):
    """What a process wrote, in order."""
    subprocess.run(["journalctl", "--sync"], check=True)
    export = subprocess.run(["journalctl", "-D", "/run/log/journal", "-o", "export", "--all", f"_PID={pid}"],
                            check=True, capture_output=True).stdout
    return parsed(export)


def values(entries, name):
    return [dict(entry)[name] for entry in entries if name in dict(entry)]


class Runner:
    """A process that records in one language."""

    def __init__(self, language, **environment):
        self.shell = language == "shell"
        self.process = subprocess.Popen(SHELL if self.shell else RUNNERS[language], stdin=subprocess.PIPE,
                                        stdout=subprocess.PIPE, stderr=subprocess.PIPE, env={**CLEAN, **environment})
        self.pid = self.process.pid

    def do(self, text):
        self.process.stdin.write(text.encode() + b"\n")
        self.process.stdin.flush()
        return int(self.process.stdout.readline())

    def record(self, what, action):
        if not self.shell:
            return self.do(line(what, action))
        self.process.stdin.write(json_line(what, action) + b"\n")
        return None

    def repeat(self, count):
        """Records an event so often. Answers how many calls failed; of the shell nothing."""
        if not self.shell:
            return self.do(line(point("burst"), f"r {count}"))
        self.process.stdin.write((json_line(point("burst"), "v") + b"\n") * count)
        self.process.stdin.flush()
        return self.wait_until_idle()

    def wait_until_idle(self):
        """Until it has read all lines and sleeps, since it waits for another."""
        state = ""
        while state != "S" or fcntl.ioctl(self.process.stdin, termios.FIONREAD, bytes(4)) != bytes(4):
            with open(f"/proc/{self.pid}/stat", encoding="utf-8", errors="replace") as file:
                state = file.read().rpartition(")")[2].split()[0]

    def close(self):
        """Exit status and lines of stderr."""
        _, errors = self.process.communicate(timeout=60)
        return self.process.returncode, errors.decode(errors="replace").splitlines()


class Daemon(unittest.TestCase):
    """Runs this script once more, beside a journal daemon of its own, for the tests of Conformance."""

    def test_beside_a_live_daemon(self):
        result = subprocess.run([os.path.join(HERE, "with-journald"), sys.executable, os.path.abspath(__file__), "Conformance"],
                                capture_output=True, text=True, check=False, timeout=500)
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)


class Conformance(unittest.TestCase):
    maxDiff = 4000

    def stopped_daemon(self, action):
        """Runs `action` while the daemon takes nothing."""
        os.kill(int(os.environ["JOURNALD_PID"]), signal.SIGSTOP)
        try:
            return action()
        finally:
            os.kill(int(os.environ["JOURNALD_PID"]), signal.SIGCONT)
            subprocess.run(["journalctl", "--sync"], check=True)  # there is room again

    def each(self, check, languages=(*RUNNERS, "shell")):
        for language in languages:
            with self.subTest(language):
                check(language)

    def test_the_table(self):
        self.each(self.check_table)

    def check_table(self, language):
        runner = Runner(language)
        expected, answers = [], []
        for case, steps in CASES.items():
            for what, action, error, *others in steps:
                wanted = others[0].get(language, error) if others else error
                if wanted is UNSAYABLE:
                    continue
                answer = runner.record(what, action)
                answers.append(wanted)
                if language != "shell" and (language, action[0]) != ("cpp", "b"):  # a scope answers at its end
                    self.assertEqual(answer, wanted, (case, action, str(what)[:200]))
                if wanted == 0:
                    expected.append((case, fields(what, action, language)))
        status, errors = runner.close()
        if language == "shell":
            refused = {int(match[1]) for match in re.finditer(r"^tesselctl: line (\d+): ", "\n".join(errors), re.M)}
            self.assertEqual(refused, {number for number, error in enumerate(answers, 1) if error}, errors)
            self.assertEqual(status, 2)
        else:
            self.assertEqual((status, errors), (0, []))
        entries = journal(runner.pid)
        for (case, wanted), entry in zip(expected, entries):
            self.assertEqual(read_back(entry), wanted, case)
        self.assertEqual(len(entries), len(expected))
        self.check_ids(entries)

    def test_logger(self):
        """What writes fields to the journal without us makes the same entry, without our checks."""
        what = CASES["every field"][0][0]
        wanted = fields(what, "v", "logger")
        lines = b"".join(name.encode() + b"=" + value + b"\n" for name, value in wanted)
        logger = subprocess.Popen(["logger", "--journald"], stdin=subprocess.PIPE)
        logger.communicate(lines)
        entry, = journal(logger.pid)
        self.assertEqual([field for field in read_back(entry) if field[0] != "SYSLOG_IDENTIFIER"], wanted)

    def test_losses(self):
        self.each(self.check_losses)

    def check_losses(self, language):
        """While the daemon takes nothing points are lost; later ones and the entry at exit say how many."""
        runner = Runner(language, TESSEL_TRACE_WAIT="0")
        runner.record(point("before"), "v")
        first = self.stopped_daemon(lambda: runner.repeat(BURST * 3))
        runner.record(point("after"), "v")
        self.stopped_daemon(lambda: runner.repeat(BURST * 3))
        began = time.monotonic()
        status, errors = runner.close()
        entries = journal(runner.pid)
        after = dict(next(entry for entry in entries if ("TESSEL_NAME", b"after") in entry))
        last = dict(entries[-1])
        totals = [int(total) for total in values(entries, "TESSEL_LOST")]
        self.assertEqual({name for name in last if name[0] != "_"}, {"PRIORITY", "TESSEL_LOST", "TESSEL_LOST_SINCE"})
        self.assertEqual(last["PRIORITY"], b"7")
        self.assertEqual(len(entries) - 1 + totals[-1], 2 + 6 * BURST)
        self.assertGreater(int(after["TESSEL_LOST"]), 100)
        self.assertEqual(totals, sorted(totals))
        self.assertEqual(len(set(values(entries, "TESSEL_LOST_SINCE"))), 1)
        self.assertLess(abs(int(last["TESSEL_LOST_SINCE"]) / 1e6 - time.time()), 60)
        self.assertLess(time.monotonic() - began, 5)
        if language == "shell":
            self.assertEqual(status, 4, errors)
            self.assertIn(f"{totals[-1]} of {2 + 6 * BURST} lines were not recorded", errors[-1].replace(",", ""))
        else:
            self.assertEqual((status, errors, int(after["TESSEL_LOST"])), (0, [], first))

    def test_waits(self):
        self.each(self.check_waits, RUNNERS)

    def check_waits(self, language):
        """A daemon that takes nothing costs a program one wait, and after it next to nothing."""
        def record(wait):
            runner = Runner(language, TESSEL_TRACE_WAIT=wait)
            start = time.monotonic()
            runner.repeat(BURST)
            middle = time.monotonic()
            runner.repeat(BURST)
            runner.process.kill()  # its last entry would wait, too
            runner.close()
            return middle - start, time.monotonic() - middle

        first, second = self.stopped_daemon(lambda: record("9" * 5000))
        self.assertTrue(1 <= first < 2 and second < 0.9, (first, second))
        first, second = self.stopped_daemon(lambda: record("soon"))
        self.assertTrue(0.02 <= first < 0.9 and second < 0.9, (first, second))

    def test_an_interval_that_lost_its_begin(self):
        self.each(self.check_lost_begin, RUNNERS)

    def check_lost_begin(self, language):
        runner = Runner(language, TESSEL_TRACE_WAIT="0")

        def lose():
            lost = runner.repeat(BURST * 2)
            answers = [runner.record(point(), action) for action in ("b:1", "e:1", "e:1")]
            self.assertEqual(answers[1:], [errno.EAGAIN] * 2)
            return lost + 2

        lost = self.stopped_daemon(lose)
        self.assertEqual(runner.record(point("last"), "v"), 0)
        self.assertEqual(runner.close(), (0, []))
        self.assertEqual(values(journal(runner.pid), "TESSEL_LOST"), [b"%d" % lost])

    def test_bursts(self):
        """The books balance however fast a program records. Nothing is lost where a call may wait for a busy daemon."""
        self.each(self.check_bursts)

    def check_bursts(self, language):
        for count, wait in ((BURST, {"TESSEL_TRACE_WAIT": "1000"}), (BAR, {})):
            runner = Runner(language, **wait)
            runner.repeat(count)
            runner.close()
            entries = journal(runner.pid)
            lost = int((values(entries, "TESSEL_LOST") or [0])[-1])
            alone = len([entry for entry in entries if "TESSEL_KIND" not in dict(entry)])
            self.assertEqual(len(entries) - alone + lost, count)
            if count == BURST:
                self.assertEqual(lost, 0)

    def test_a_forked_child_counts_for_itself(self):
        self.each(self.check_fork, ("c", "cpp", "python", "rust"))

    def check_fork(self, language):
        runner = Runner(language, TESSEL_TRACE_WAIT="0")
        lost = self.stopped_daemon(lambda: runner.repeat(BURST * 2))
        runner.do("fork")
        with open(f"/proc/{runner.pid}/task/{runner.pid}/children", encoding="ascii") as file:
            child = int(file.read())
        runner.record(point("child"), "v")
        lost_by_child = self.stopped_daemon(lambda: runner.repeat(BURST * 3))
        self.assertEqual(runner.close()[0], 0)
        self.assertNotIn("TESSEL_LOST", dict(journal(child)[0]))
        self.assertEqual(values(journal(child), "TESSEL_LOST"), [b"%d" % lost_by_child])
        self.assertEqual(values(journal(runner.pid), "TESSEL_LOST"), [b"%d" % lost])

    def test_a_point_that_fits_no_datagram(self):
        self.each(self.check_oversize, RUNNERS)

    def check_oversize(self, language):
        """From C it travels in a memory file. Elsewhere it is lost, and counted."""
        runner = Runner(language)
        runner.record(point(), "v")
        runner.do("z")
        answer = runner.record(LARGE, "v")
        self.assertEqual(runner.record(point(), "v"), 0)
        self.assertEqual(runner.close(), (0, []))
        in_file = language in ("c", "cpp")
        self.assertEqual(answer, 0 if in_file else errno.EMSGSIZE)
        self.assertEqual(values(journal(runner.pid), "TESSEL_LOST"), [] if in_file else [b"1"])

    def test_the_environment(self):
        self.each(self.check_environment)

    def check_environment(self, language):
        """The off switch, mistakes told, and a machine without a daemon."""
        off = Runner(language, TESSEL_TRACE="0")
        answers = [off.record(point(subsystem="s" * count), "v") for count in (1, 0)]
        self.assertEqual(off.close()[1], [])
        self.assertEqual((journal(off.pid), set(answers) - {None}), ([], {0} if language != "shell" else set()))
        check = Runner(language, TESSEL_TRACE="check")
        for what in (point(subsystem=""), point(subsystem=""), point(OVER), point(OVER + "x"), point("fine")):
            check.record(what, "v")
        told = check.close()[1]
        if language != "shell":  # it always says why
            self.assertEqual([text.partition(": refused: ")[2] for text in told],
                             ["the subsystem is missing", "TESSEL_NAME has 4097 bytes, the limit is 4096"])
            self.assertRegex(told[0], r"^tessel: (runner|main)\.\w+:\d+: ")
        self.assertEqual(len(journal(check.pid)), 1)
        if language in ("c", "cpp", "go"):
            dropped = Runner(language, TESSEL_TRACE="check")
            self.assertEqual(dropped.record(point(n1=("i", None, 5)), "v"), 0)
            told = dropped.close()[1]
            self.assertEqual([text.partition(": ")[2].partition(": ")[2] for text in told],
                             ["dropped: number1 has a value and no label"])
        absent = Runner(language, TESSEL_JOURNAL_SOCKET="/nowhere")
        self.assertIn(absent.record(point(), "v"), (errno.ENOENT, None))
        self.assertEqual(absent.close()[0], 0 if language != "shell" else 4)

    def test_closed_standard_streams(self):
        self.each(self.check_streams, RUNNERS)

    def check_streams(self, language):
        """The socket takes none of their numbers: what the program writes there would go to the journal."""
        closed = subprocess.Popen(["sh", "-c", 'exec "$@" 2>&-', "sh", *RUNNERS[language]], env=CLEAN, text=True,
                                  stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        closed.stdin.write(line(point(), "v") + "\n")
        closed.stdin.flush()
        self.assertEqual(closed.stdout.readline(), "0\n")
        descriptors = f"/proc/{closed.pid}/fd"
        sockets = {fd for fd in os.listdir(descriptors) if os.readlink(f"{descriptors}/{fd}").startswith("socket:")}
        closed.communicate(timeout=60)
        self.assertTrue(sockets and not sockets & {"0", "1", "2"}, sockets)

    def test_an_interrupted_wait(self):
        """A signal handler of Python may raise while a call waits. The point of that call is lost."""
        program = ("import signal, tessel\n"
                   "signal.signal(signal.SIGALRM, signal.default_int_handler)\n"
                   "while tessel.event('s', 'c', no_wait=True) == 0: pass\n"
                   "signal.setitimer(signal.ITIMER_REAL, 0.3)\n"
                   "try: tessel.event('s', 'c')\n"
                   "except KeyboardInterrupt: print(tessel.lost(), flush=True)\n"
                   "import os; os._exit(0)\n")
        result = self.stopped_daemon(lambda: subprocess.run(
            ["/usr/bin/python3", "-c", program], env={**CLEAN, "TESSEL_TRACE_WAIT": "1000"}, capture_output=True,
            text=True, check=False, timeout=60))
        self.assertEqual((result.stdout, result.stderr), ("2\n", ""))

    def check_ids(self, entries):
        """A begin and its end have one id, and no other interval of the process has it."""
        own = [dict(entry) for entry in entries if dict(entry).get("TESSEL_NAME") == b"n" and "TESSEL_INTERVAL_ID" in dict(entry)]
        ids = [(entry["TESSEL_KIND"], entry["TESSEL_INTERVAL_ID"]) for entry in own]
        self.assertEqual([kind for kind, _ in ids][:5], [b"end", b"begin", b"begin", b"end", b"end"])
        self.assertEqual((ids[1][1], ids[2][1]), (ids[3][1], ids[4][1]))
        self.assertNotEqual(ids[1][1], ids[2][1])

class PythonAlone(unittest.TestCase):
    def test_mistakes_that_only_python_allows(self):
        program = ("import fractions, sys, tessel\n"
                   "print(tessel.event('s', 'c', number1=('n', fractions.Fraction(10 ** 400))))\n"
                   "sys.stderr = None\n"
                   "print(tessel.event('', 'c'))\n"
                   "try: tessel.interval('s', 'c').nubmer1 = ('n', 1)\n"
                   "except AttributeError: print('misspelt')\n")
        result = subprocess.run(["/usr/bin/python3", "-c", program], capture_output=True, text=True, check=False,
                                env={**CLEAN, "TESSEL_TRACE": "check", "TESSEL_JOURNAL_SOCKET": "/nowhere"})
        self.assertEqual(result.stdout.split(), [str(errno.EDOM), str(errno.EINVAL), "misspelt"])
        self.assertRegex(result.stderr, r"^tessel: <string>:2: refused: number1 is not finite\n$")


class Examples(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name

    def built(self, sources, prefix):
        """What the examples include the header from, after they were configured and built alone."""
        build = os.path.join(self.directory, "build-" + os.path.basename(prefix))
        options = ["-G", "Ninja", "-DCMAKE_EXPORT_COMPILE_COMMANDS=ON", "-DCMAKE_PREFIX_PATH=" + prefix]
        for command in (["-S", sources, "-B", build, *options], ["--build", build]):
            result = subprocess.run(["cmake", *command], capture_output=True, text=True, check=False, env=CLEAN)
            self.assertEqual(result.returncode, 0, result.stdout + result.stderr)
        with open(os.path.join(build, "compile_commands.json"), encoding="utf-8") as file:
            return re.search(r"(-I|-isystem )(\S+/include) ", file.read())[2]

    def test_they_build_alone(self):
        source = self.built(os.path.join(ROOT, "examples"), os.path.join(self.directory, "none"))
        self.assertEqual(os.path.realpath(source), os.path.join(ROOT, "include"))
        prefix = os.path.join(self.directory, "installed")
        subprocess.run(["cmake", "--install", os.path.dirname(BIN), "--prefix", prefix],
                       check=True, stdout=subprocess.DEVNULL)
        shipped = os.path.join(prefix, "share/doc/tessel-reporter/examples")
        self.assertEqual(self.built(shipped, prefix), os.path.join(prefix, "include"))
        flags = subprocess.run(["pkg-config", "--cflags", "tessel-trace"], check=True, capture_output=True, text=True,
                               env={**CLEAN, "PKG_CONFIG_PATH": os.path.join(prefix, "share/pkgconfig")}).stdout.split()
        subprocess.run(["cc", "-std=c11", "-Werror", *flags, os.path.join(shipped, "record.c"), "-o", prefix + "/c"], check=True)

    def test_the_header_builds_without_warnings(self):
        strict = "-O1 -Wall -Wextra -pedantic -Wshadow -Wconversion -Werror -c -o /dev/null -I".split() + [os.path.join(ROOT, "include")]
        for compiler, standard, example in (("gcc", "c11", "record.c"), ("clang-14", "c11", "record.c"), ("g++", "c++17", "record.cpp"),
                                            ("clang++-14", "c++17", "record.cpp"), ("g++", "c++20", "record.cpp")):
            for disabled in ([], ["-DTESSEL_TRACE_DISABLED"]):
                source = os.path.join(ROOT, "examples", example)
                result = subprocess.run([compiler, "-std=" + standard, *strict, *disabled, source], capture_output=True, text=True,
                                        check=False)
                self.assertEqual((result.returncode, result.stderr), (0, ""), (compiler, standard, disabled))

    def test_an_old_standard_is_one_error(self):
        source = os.path.join(self.directory, "program.c")
        with open(source, "w", encoding="ascii") as file:
            file.write("#include <tessel/trace.h>\nint main(void) { return 0; }\n")
        for compiler in (["gcc", "-std=c89"], ["gcc", "-std=c99"], ["g++", "-x", "c++", "-std=c++14"], ["clang-14", "-std=c99"]):
            result = subprocess.run([*compiler, "-fsyntax-only", "-I", os.path.join(ROOT, "include"), source],
                                    capture_output=True, text=True, check=False)
            self.assertEqual(result.stderr.count("error: "), 1, result.stderr)
            self.assertIn("needs C11 or C++17", result.stderr)


def load_tests(_loader, tests, _pattern):
    """Without names on the command line: all tests but those of Conformance, which Daemon starts beside its daemon."""
    return unittest.TestSuite(suite for suite in tests if not any(isinstance(test, Conformance) for test in suite))


if __name__ == "__main__":
    harness.main()
