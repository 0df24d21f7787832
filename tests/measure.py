"""Measures the time, processor time and memory of one run of the service."""
import os
import re
import tempfile
import threading
import time

from harness import BIN, in_namespace_argv


class Cost:
    def __init__(self, status, stderr, seconds, usage, anonymous):
        self.status, self.stderr, self.seconds = status, stderr, seconds
        self.processor_seconds = usage.ru_utime + usage.ru_stime
        self.anonymous = anonymous  # peak memory in KiB that is not pages of files

    @property
    def log(self):
        return self.stderr.splitlines()


def anonymous_memory(pid):
    try:
        with open(f"/proc/{pid}/status", encoding="ascii") as file:
            found = re.search(r"^RssAnon:\s*(\d+) kB", file.read(), re.M)
            return int(found.group(1)) if found else 0
    except (FileNotFoundError, ProcessLookupError):
        return 0


def run_measured(machine, **extra):
    """Runs the service once. unshare and sh replace themselves by the next program (exec), so the process
    that is measured here is the service itself."""
    command = in_namespace_argv(machine.var_tmp, [os.path.join(BIN, "tessel_reporter")])
    peak, ended = [0], threading.Event()

    def watch(pid):
        while not ended.wait(0.01):
            peak[0] = max(peak[0], anonymous_memory(pid))

    with tempfile.TemporaryFile() as errors, open(os.devnull, "r+b") as nothing:
        began = time.monotonic()
        pid = os.posix_spawnp(command[0], command, machine.environment(**extra), file_actions=[
            (os.POSIX_SPAWN_DUP2, nothing.fileno(), 0), (os.POSIX_SPAWN_DUP2, nothing.fileno(), 1),
            (os.POSIX_SPAWN_DUP2, errors.fileno(), 2)])
        watcher = threading.Thread(target=watch, args=(pid,))
        watcher.start()
        _, status, usage = os.wait4(pid, 0)
        seconds = time.monotonic() - began
        ended.set()
        watcher.join()
        errors.seek(0)
        stderr = errors.read().decode("utf-8", "surrogateescape")
    return Cost(os.waitstatus_to_exitcode(status), stderr, seconds, usage, peak[0])
