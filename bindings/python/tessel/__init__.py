"""Trace points: records events, intervals and animations for tessel_reporter.

    import tessel

    tessel.event("com.vantor.Calendar", "View", "Open", telemetry=True,
                 string1=("period", "week"), number1=("events", 12))

    with tessel.interval("com.vantor.Calendar", "View", "Load", telemetry=True) as load:
        load.number1 = ("bytes", read_month())  # known only now

    @tessel.interval("com.vantor.Calendar", "View", "Save")
    def save(): ...

Needs Linux and the standard library alone. A trace point is an entry of the system journal and is
sent as one datagram to the journal's socket.

Every call answers 0 or an errno value, and raises nothing for a trace point that it cannot record.
These are mistakes of the caller, and nothing is recorded:

    EINVAL        subsystem or category missing or empty; a text of another type than str, or with a NUL
    EBADMSG       a labelled string or number that is not (label, value); an attribute without a value
    EDOM          a number that is not finite, or does not fit 64 bits, or is no number
    EMSGSIZE      a text longer than VALUE_MAX bytes
    ENOKEY        an attribute key that is empty, or holds '=' or a line feed
    ENAMETOOLONG  an attribute key longer than KEY_MAX bytes
    E2BIG         more than ATTRIBUTES_MAX attributes
    ECANCELED     the end of an interval that was begun while recording was off, or ended before

Any other value means that the trace point is lost, and counted: EAGAIN, the journal had no room;
ENOENT or ECONNREFUSED, no journal is running; EMSGSIZE, where the point is larger than the socket's
buffer; or another error of the system.

Waiting: where the journal has no room, a call waits for it, at most 20 ms. After a wait that ended in
nothing, calls wait 1 ms in each second, until a trace point is taken again. `no_wait=True`, or
TESSEL_TRACE_WAIT=0 in the environment, never waits; another number there is the longest wait in
milliseconds, up to 1000. Code on an event loop should say no_wait=True.

Losses: each later trace point says how many this process has lost so far. When the interpreter exits,
it says it once more where the number has grown since, and waits up to 1 s to do so. os._exit() and a
signal that kills skip that: call flush() before. A forked child counts for itself, from zero.

TESSEL_TRACE in the environment, read by the first call: 0 records nothing; `check` tells mistakes and
losses on standard error, once for each place in the source. Any thread may call any function.
"""

import copy
import errno
import numbers
import struct
import time
from typing import Any, Callable, Mapping, Optional, Tuple, TypeVar, Union

from ._journal import RECORDER, Refused, field

__all__ = ["ATTRIBUTES_MAX", "KEY_MAX", "VALUE_MAX", "Interval", "enable", "enabled", "end", "event", "flush",
           "interval", "lost"]

VALUE_MAX = 4096  # bytes of one text; of key, '=' and value of an attribute
KEY_MAX = 64  # bytes of an attribute key
ATTRIBUTES_MAX = 32  # attributes of one trace point

String = Tuple[str, str]  # label and value
Number = Tuple[str, Union[int, float]]  # label and value
_Function = TypeVar("_Function", bound=Callable[..., Any])


def _text(name: str, value: Any, words: str = "") -> bytes:
    """A field; what came in as undecodable bytes (os.fsdecode) goes out as the same bytes."""
    if not isinstance(value, str):
        raise Refused(errno.EINVAL, f"{name} is a {type(value).__name__}, not a str")
    try:
        data = value.encode()
    except UnicodeEncodeError:
        try:
            data = value.encode("utf-8", "surrogateescape")
        except UnicodeEncodeError:
            raise Refused(errno.EINVAL, f"{name} holds a lone surrogate") from None
        RECORDER.say("changed", f"{name} is not UTF-8")
    if b"\0" in data:
        raise Refused(errno.EINVAL, f"{name} holds a NUL")
    if len(data) > VALUE_MAX:
        raise Refused(errno.EMSGSIZE, f"{words or name} has {len(data)} bytes, the limit is {VALUE_MAX}", words or name)
    return field(name, data)


def _decimal(name: str, value: Any, words: str = "") -> bytes:
    """An integer that fits 64 bits, signed or not, stays one; a float reads back as the same float."""
    if isinstance(value, numbers.Integral) and not isinstance(value, bool):
        value = int(value)
        if not -(2**63) <= value < 2**64:
            raise Refused(errno.EDOM, f"{words} does not fit 64 bits")
        return field(name, b"%d" % value)
    if not isinstance(value, numbers.Real) or isinstance(value, bool):
        raise Refused(errno.EDOM, f"{words} is a {type(value).__name__}, neither int nor float")
    try:
        value = float(value)
    except OverflowError:  # a fraction
        value = float("inf")
    if value != value or value in (float("inf"), float("-inf")):
        raise Refused(errno.EDOM, f"{words} is not finite")
    text = b"%.15g" % value
    if float(text) != value:
        text = b"%.17g" % value
    return field(name, text if b"." in text or b"e" in text else text + b".0")


def _string(name: str, value: Any, _slot: str) -> bytes:
    return _text(name, value)


def _labelled(slot: str, pair: Any, encode: Callable[..., bytes]) -> bytes:
    if not isinstance(pair, (tuple, list)) or len(pair) != 2:
        raise Refused(errno.EBADMSG, f"{slot} is not (label, value)")
    if pair[0] is None or pair[1] is None:
        missing = "a value and no label" if pair[0] is None else "a label and no value"
        raise Refused(errno.EBADMSG, f"{slot} has {missing}")
    name = "TESSEL_" + slot.upper()
    return _text(name + "_NAME", pair[0]) + encode(name + "_VALUE", pair[1], slot)


def _attribute(key: Any, value: Any) -> bytes:
    if key is None or key == "":
        raise Refused(errno.ENOKEY, "an attribute has no key")
    if not isinstance(key, str) or "=" in key or "\n" in key:
        words = "an attribute key holds '=' or a line feed" if isinstance(key, str) else "an attribute key is no str"
        raise Refused(errno.ENOKEY, words)
    if value is None:
        raise Refused(errno.EBADMSG, "an attribute has no value")
    size = len(key.encode("utf-8", "replace"))
    if size > KEY_MAX:
        raise Refused(errno.ENAMETOOLONG, f"an attribute key has {size} bytes, the limit is {KEY_MAX}", "key")
    if not isinstance(value, str):
        raise Refused(errno.EINVAL, f"the value of an attribute is a {type(value).__name__}, not a str")
    return _text("TESSEL_ATTRIBUTE", key + "=" + value, "an attribute")


def _attributes(attributes: Any) -> bytes:
    if not isinstance(attributes, Mapping):
        raise Refused(errno.EINVAL, "attributes are no mapping")
    if len(attributes) > ATTRIBUTES_MAX:
        words = f"there are {len(attributes)} attributes, the limit is {ATTRIBUTES_MAX}"
        raise Refused(errno.E2BIG, words, "attributes")
    return b"".join(_attribute(key, value) for key, value in attributes.items())


def _frame_rate(rate: Any) -> bytes:
    """The reader keeps it as a 32-bit float, so one that is no such float would cost the interval."""
    if rate is None:
        return b""
    try:
        struct.pack("<f", rate)  # beyond all floats: OverflowError
        return _decimal("TESSEL_FRAME_RATE", float(rate), "frame_rate")
    except (OverflowError, TypeError, struct.error):
        raise Refused(errno.EDOM, "frame_rate is not finite") from None


class _Point:
    """What a trace point says. Slots: to set one that does not exist, misspelt, is an error."""

    __slots__ = ("subsystem", "category", "name", "string1", "string2", "number1", "number2", "attributes",
                 "interval_id", "system_scope", "telemetry", "no_wait", "_error", "_open", "_lost", "_start", "_own_id")

    def __init__(self, subsystem: str, category: str, name: Optional[str] = None, *,
                 string1: Optional[String] = None, string2: Optional[String] = None,
                 number1: Optional[Number] = None, number2: Optional[Number] = None,
                 attributes: Optional[Mapping[str, str]] = None, interval_id: Optional[str] = None,
                 system_scope: bool = False, telemetry: bool = False, no_wait: bool = False) -> None:
        self.subsystem = subsystem
        self.category = category
        self.name = name
        self.string1 = string1
        self.string2 = string2
        self.number1 = number1
        self.number2 = number2
        self.attributes = attributes
        self.interval_id = interval_id
        self.system_scope = system_scope
        self.telemetry = telemetry
        self.no_wait = no_wait
        # Of an interval alone.
        self._error = 0  # of the begin; what the end answers while the interval is not open
        self._open = False
        self._lost = False  # the begin, and the end was not counted yet
        self._start = 0
        self._own_id = b""

    def encoded(self, kind: str) -> bytes:
        if self.subsystem is None or self.subsystem == "":
            raise Refused(errno.EINVAL, "the subsystem is missing")
        if self.category is None or self.category == "":
            raise Refused(errno.EINVAL, "the category is missing")
        message = field("TESSEL_KIND", kind.encode()) + b"PRIORITY=7\n" + _text("TESSEL_SUBSYSTEM", self.subsystem)
        message += _text("TESSEL_CATEGORY", self.category)
        if self.name is not None:
            message += _text("TESSEL_NAME", self.name)
        if self.telemetry:
            message += b"TESSEL_TELEMETRY=1\n"
        for slot, pair, encode in (("string1", self.string1, _string), ("string2", self.string2, _string),
                                   ("number1", self.number1, _decimal), ("number2", self.number2, _decimal)):
            if pair is not None:
                message += _labelled(slot, pair, encode)
        if self.attributes is not None:
            message += _attributes(self.attributes)
        if kind != "event":
            if self.interval_id is not None:
                message += _text("TESSEL_INTERVAL_ID", self.interval_id)
            if self.system_scope:
                message += b"TESSEL_INTERVAL_SCOPE=system\n"
        return message


class Interval(_Point):
    """An interval: begin() and end(), or a `with` block, or a function that it decorates.

    Its attributes (`number1`, ...) may be set until the end; what the end says wins over the begin.
    A `with` block records the end however it is left. A decorated function may run many times, and
    in many threads: each call is an interval of its own, and so is each call of an `async def`.
    """

    __slots__ = ()

    def begin(self) -> int:
        """Begins the interval; called again, begins another."""
        self._open = self._lost = False
        self._error = 0
        if not RECORDER.enabled():
            return 0
        self._start = time.monotonic_ns()
        # Unique in the process. A second begin with one id would take the place of the first.
        own_id = RECORDER.next_id(self._start)
        self._own_id = b"" if self.interval_id is not None else field("TESSEL_INTERVAL_ID", own_id)
        self._error, self._lost = RECORDER.record(lambda: self.encoded("begin") + self._own_id, self.no_wait)
        self._open = self._error == 0
        return self._error

    def end(self, *, frame_rate: Optional[float] = None) -> int:
        """Ends it, with the time since its begin. With `frame_rate` it measured an animation."""
        if not RECORDER.enabled():
            return 0
        if not self._open:
            return self._end_unopened()
        self._open = False
        seconds, rest = divmod(time.monotonic_ns() - self._start, 1_000_000_000)
        more = self._own_id + field("TESSEL_DURATION", b"%d.%09d" % (seconds, rest))
        return RECORDER.record(lambda: self.encoded("end") + more + _frame_rate(frame_rate), self.no_wait)[0]

    def _end_unopened(self) -> int:
        """Where its begin is lost, the end is lost with it: alone it would pair with nothing. It counts
        once, however often it is tried."""
        lost, self._lost = self._lost, False
        if lost:
            RECORDER.count_lost()
        refused = "its begin was refused" if self._error else "the interval is not open"
        RECORDER.say(*(("lost", "its begin was lost") if lost else ("refused", refused)))
        return self._error or errno.ECANCELED

    def __enter__(self) -> "Interval":
        self.begin()
        return self

    def __exit__(self, *_exception: object) -> None:
        if self._open or self._lost:  # a block may have ended it before
            self.end()

    def _another(self) -> "Interval":
        another = copy.copy(self)
        another._open = another._lost = False
        another._error = 0
        return another

    def __call__(self, function: _Function) -> _Function:
        import functools
        import inspect

        if inspect.iscoroutinefunction(function):
            @functools.wraps(function)
            async def measured_async(*args: Any, **kwargs: Any) -> Any:
                with self._another():
                    return await function(*args, **kwargs)
            return measured_async  # type: ignore[return-value]

        @functools.wraps(function)
        def measured(*args: Any, **kwargs: Any) -> Any:
            with self._another():
                return function(*args, **kwargs)
        return measured  # type: ignore[return-value]


def event(subsystem: str, category: str, name: Optional[str] = None, *, string1: Optional[String] = None,
          string2: Optional[String] = None, number1: Optional[Number] = None, number2: Optional[Number] = None,
          attributes: Optional[Mapping[str, str]] = None, telemetry: bool = False, no_wait: bool = False) -> int:
    """Records a single event. Without `telemetry` it stays on the machine and is only counted."""
    if not RECORDER.enabled():
        return 0
    point = _Point(subsystem, category, name, string1=string1, string2=string2, number1=number1, number2=number2,
                   attributes=attributes, telemetry=telemetry)
    return RECORDER.record(lambda: point.encoded("event"), no_wait)[0]


interval = Interval  # reads as what it makes: `with tessel.interval(...)`


def end(subsystem: str, category: str, name: Optional[str] = None, *, frame_rate: Optional[float] = None,
        no_wait: bool = False, **point: Any) -> int:
    """Ends an interval that was begun elsewhere, perhaps by another process in system scope; `point` has
    further arguments of `interval`. The reader takes the duration from the two times."""
    if not RECORDER.enabled():
        return 0
    whole = _Point(subsystem, category, name, **point)
    return RECORDER.record(lambda: whole.encoded("end") + _frame_rate(frame_rate), no_wait)[0]


def enabled() -> bool:
    """Whether trace points are recorded: ask before work that is done for a trace point only."""
    return RECORDER.enabled()


def enable(on: bool) -> None:
    """Switches recording on or off for the program, whatever the environment says."""
    RECORDER.enable(on)


def lost() -> int:
    """How many trace points this process has lost so far."""
    return RECORDER.lost


def flush() -> None:
    """Says how many points were lost, where no later point has said so. The interpreter calls it at exit."""
    RECORDER.flush()
