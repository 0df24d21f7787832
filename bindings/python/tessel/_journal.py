"""The way to the journal: one non-blocking datagram socket for the process, messages in the journal's
native form, a bounded wait, and the count of what was lost. For the package alone.
"""

import atexit
import errno
import fcntl
import os
import select
import socket
import stat
import struct
import sys
import threading
import time
from typing import Callable, Optional, Set, Tuple

SOCKET = "/run/systemd/journal/socket"
# The reader's sums hold 64 bits; 42 is what the C header has room for.
LOST_MAX = 2**42 - 1
WAIT_MS = 20
WAIT_MS_MAX = 1000
# After a wait that ended without room a call may wait a thousandth of the time since that wait began:
# a journal that takes nothing costs a program no more.
WAIT_SHARE = 1000
# Nothing repeats the entry at exit, so it waits longer than a call, and where no call may wait.
FLUSH_WAIT_NS = 1_000_000_000
# We get what the system gives at most, usually 400 KiB: a burst of 300 points then finds room.
SEND_BUFFER = 8 << 20


class Refused(Exception):
    """A point that breaks a rule; it never leaves the package. `kind` stands for the words where we ask
    whether they were told: it lacks numbers that may be others each time."""

    def __init__(self, number: int, words: str, kind: str = "") -> None:
        super().__init__(words)
        self.number = number
        self.kind = kind or words


def field(name: str, value: bytes) -> bytes:
    """One field in the journal's native form. A value with a line feed goes by length, or it could
    forge fields."""
    if b"\n" in value:
        return name.encode() + b"\n" + struct.pack("<Q", len(value)) + value + b"\n"
    return name.encode() + b"=" + value + b"\n"


def _wait_from_environment() -> int:
    text = os.environ.get("TESSEL_TRACE_WAIT", "")
    if not text.isascii() or not text.isdigit():
        return WAIT_MS
    digits = text.lstrip("0")[:5]  # int() refuses thousands of them
    return min(int(digits or "0"), WAIT_MS_MAX)


def _has_more_rights() -> bool:
    """Whether the program runs with more rights than its caller, as the kernel sees it. Then the caller's
    environment chooses no socket, and standard error may be something else."""
    at_secure = 23
    try:
        with open("/proc/self/auxv", "rb") as file:
            return dict(struct.iter_unpack("@NN", file.read())).get(at_secure, 0) != 0
    except (OSError, struct.error):
        return os.getuid() != os.geteuid() or os.getgid() != os.getegid()


def _caller() -> Tuple[str, int]:
    """File and line that called into the package."""
    frame = sys._getframe(1)
    while frame.f_back is not None and frame.f_globals.get("__package__") == __package__:
        frame = frame.f_back
    return frame.f_code.co_filename, frame.f_lineno


class Recorder:
    """One per process. The lock is reentrant, because a signal handler may record, too."""

    def __init__(self) -> None:
        self._mode: Optional[bool] = None
        self._check = False
        self._told_places: Set[Tuple[str, int, str, str]] = set()
        self._wait_ns = WAIT_MS * 1_000_000
        self._lock = threading.RLock()
        self._socket: Optional[socket.socket] = None
        self._inode = 0
        self._intervals = 0
        self._taken = 0  # points that the socket took; threads may miss one of another, which does no harm
        self._stuck = 0  # when the last wait began that ended without room, in monotonic ns; 0: none
        self.lost = 0
        self._since = 0  # microseconds since 1970 of the first loss
        self._told = 0  # the greatest total that the socket took

    # --- On and off.

    def enabled(self) -> bool:
        if self._mode is None:
            self._resolve()
        return bool(self._mode)

    def enable(self, on: bool) -> None:
        self._resolve()
        self._mode = on

    def _resolve(self) -> None:
        value = os.environ.get("TESSEL_TRACE", "")
        self._check = value == "check" and not _has_more_rights()
        self._wait_ns = _wait_from_environment() * 1_000_000
        self._mode = value != "0"

    # --- Recording.

    def next_id(self, start: int) -> bytes:
        with self._lock:
            self._intervals += 1
            return b"%d" % ((self._intervals << 40 ^ start) & (2**64 - 1))

    def record(self, encode: Callable[[], bytes], no_wait: bool) -> Tuple[int, bool]:
        """Sends what `encode` makes. Answers 0 or an errno value, and whether the point is lost. One that
        breaks a rule is no lost one: that is a mistake of the program, and the same every time."""
        try:
            message = encode()
        except Refused as refused:
            self.say("refused", str(refused), refused.kind)
            return refused.number, False
        total = self.lost
        error = self._deliver(message + self._losses(total), no_wait)
        if error == 0:
            self._note_told(total)
            return 0, False
        self.count_lost()
        words = {errno.EAGAIN: "the journal has no room", errno.ENOENT: "no journal is running",
                 errno.ECONNREFUSED: "no journal is running"}
        self.say("lost", words.get(error) or os.strerror(error))
        return error, True

    def flush(self) -> None:
        total = self.lost
        if total <= self._told:
            return
        message = b"PRIORITY=7\n" + self._losses(total)
        error = self._offer(message)
        if error == errno.EAGAIN:
            error = self._offer_within(message, FLUSH_WAIT_NS)
        if error == 0:
            self._note_told(total)

    def say(self, effect: str, words: str, kind: str = "") -> None:
        """What TESSEL_TRACE=check asks for, once for each place and mistake."""
        if not self._check:
            return
        file, line = _caller()
        told = (file, line, effect, kind or words)
        with self._lock:
            if told in self._told_places:
                return
            self._told_places.add(told)
        if sys.stderr is None:
            return
        try:
            print(f"tessel: {os.path.basename(file)}:{line}: {effect}: {words}", file=sys.stderr)
        except (OSError, ValueError, RuntimeError):
            pass  # nobody to tell, or a signal handler came while another line was printed

    # --- Losses and forks.

    def _losses(self, total: int) -> bytes:
        return b"TESSEL_LOST=%d\nTESSEL_LOST_SINCE=%d\n" % (total, self._since) if total else b""

    def _note_told(self, total: int) -> None:
        if total > self._told:
            with self._lock:
                self._told = max(self._told, total)

    def count_lost(self) -> None:
        with self._lock:
            self._since = self._since or time.time_ns() // 1000
            self.lost = min(self.lost + 1, LOST_MAX)
            first = self.lost == 1
        parent = getattr(sys.modules.get("multiprocessing"), "parent_process", lambda: None)
        if first and parent() is not None:
            # The children of multiprocessing end by os._exit(), which skips atexit but not these.
            from multiprocessing import util

            util.Finalize(None, self.flush, exitpriority=0)

    def after_fork_in_child(self) -> None:
        """The child's losses are its own. Another thread may have held the lock while we forked. The
        socket stays: a datagram carries its sender."""
        self._lock = threading.RLock()
        self.lost = self._since = self._told = self._stuck = 0

    # --- Sending.

    def _deliver(self, message: bytes, no_wait: bool) -> int:
        error = self._offer(message)
        if error == errno.EAGAIN and not no_wait:
            try:
                error = self._wait(message)
            except BaseException:  # of a signal handler, as Ctrl-C raises it: nobody tries this point again
                self.count_lost()
                raise
        if error == 0:
            self._taken += 1
            self._stuck = 0
        return error

    def _offer(self, message: bytes) -> int:
        """One attempt, to the journal's successor where it was restarted."""
        try:
            sock = self._connected()
            try:
                sock.send(message)
            except OSError as error:
                if error.errno not in (errno.ECONNREFUSED, errno.ENOTCONN, errno.ECONNRESET):
                    raise
                sock.connect(self._path())
                sock.send(message)
        except OSError as error:
            return error.errno or errno.EIO
        return 0

    def _wait(self, message: bytes) -> int:
        """Waits for room. After a wait that ended without any, the daemon takes nothing, and programs must
        not stand still for it. Who takes the time that was earned since sets its beginning anew, so it
        is taken once however many threads record."""
        now, taken = time.monotonic_ns(), self._taken
        with self._lock:
            limit = min(self._wait_ns, (now - self._stuck) // WAIT_SHARE) if self._stuck else self._wait_ns
            if limit < 1_000_000:
                return errno.EAGAIN
            if self._stuck:
                self._stuck = now
        error = self._offer_within(message, limit)
        if error == errno.EAGAIN and taken == self._taken:  # no other thread was quicker each time
            self._stuck = now
        return error

    def _offer_within(self, message: bytes, limit_ns: int) -> int:
        """Another thread may take the room before us, so we may wait again."""
        deadline = time.monotonic_ns() + limit_ns
        error = errno.EAGAIN
        while error == errno.EAGAIN and (left := deadline - time.monotonic_ns()) > 0:
            room = select.poll()
            try:
                room.register(self._connected(), select.POLLOUT)
            except OSError as missing:
                return missing.errno or errno.EIO
            room.poll(left / 1_000_000)
            error = self._offer(message)
        return error

    # --- The socket.

    def _connected(self) -> socket.socket:
        """A program that closes descriptors it does not know (a daemon does) may have closed ours, and
        something else may have its number now. So we look at what is there before each use."""
        sock = self._socket
        if sock is not None and self._is_ours(sock):
            return sock
        with self._lock:
            if self._socket is not sock and self._socket is not None:
                return self._socket  # another thread was faster
            if sock is not None:
                sock.detach()
            self._socket = None
            fresh = self._opened()
            self._inode = os.fstat(fresh.fileno()).st_ino
            self._socket = fresh  # last: a thread without the lock compares it with the inode
            return fresh

    def _is_ours(self, sock: socket.socket) -> bool:
        try:
            status = os.fstat(sock.fileno())
        except OSError:
            return False
        return status.st_ino == self._inode and stat.S_ISSOCK(status.st_mode)

    def _opened(self) -> socket.socket:
        sock = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM | socket.SOCK_NONBLOCK | socket.SOCK_CLOEXEC)
        try:
            if sock.fileno() <= 2:  # away from the numbers of the standard streams
                with sock:
                    sock = socket.socket(fileno=fcntl.fcntl(sock, fcntl.F_DUPFD_CLOEXEC, 3))
            sock.setsockopt(socket.SOL_SOCKET, socket.SO_SNDBUF, SEND_BUFFER)
            sock.connect(self._path())
        except BaseException:
            sock.close()
            raise
        return sock

    @staticmethod
    def _path() -> str:
        return (os.environ.get("TESSEL_JOURNAL_SOCKET") if not _has_more_rights() else None) or SOCKET


RECORDER = Recorder()
atexit.register(RECORDER.flush)
os.register_at_fork(after_in_child=RECORDER.after_fork_in_child)
