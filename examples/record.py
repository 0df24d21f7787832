#!/usr/bin/env python3
"""Records an event and an interval from Python, with the standard library alone.

A trace point is an entry of the journal: fields, sent to its socket as one datagram.
"""

import contextlib
import itertools
import os
import socket
import struct
import time

JOURNAL = os.environ.get("TESSEL_JOURNAL_SOCKET", "/run/systemd/journal/socket")

_socket = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM | socket.SOCK_NONBLOCK)
_intervals = itertools.count(1)


def send(fields):
    """Sends one entry; a journal that is full or absent costs the entry, not the program."""
    message = bytearray()
    for name, value in fields.items():
        data = str(value).encode()
        if b"\n" in data:  # such a value goes by length, or it could forge fields
            message += name.encode() + b"\n" + struct.pack("<Q", len(data)) + data + b"\n"
        else:
            message += name.encode() + b"=" + data + b"\n"
    with contextlib.suppress(OSError):
        _socket.sendto(message, JOURNAL)


def point(kind, subsystem, category, name, telemetry=False, **fields):
    """One trace point; further fields by their names without TESSEL_, such as STRING1_NAME."""
    entry = {
        "PRIORITY": 7,
        "TESSEL_KIND": kind,
        "TESSEL_SUBSYSTEM": subsystem,
        "TESSEL_CATEGORY": category,
        "TESSEL_NAME": name,
    }
    if telemetry:
        entry["TESSEL_TELEMETRY"] = 1
    entry.update({"TESSEL_" + key: value for key, value in fields.items()})
    send(entry)


@contextlib.contextmanager
def interval(subsystem, category, name, **fields):
    """Records the time that its block takes."""
    interval_id = next(_intervals)
    point("begin", subsystem, category, name, INTERVAL_ID=interval_id, **fields)
    start = time.monotonic_ns()
    try:
        yield
    finally:
        seconds, rest = divmod(time.monotonic_ns() - start, 1_000_000_000)
        point("end", subsystem, category, name, INTERVAL_ID=interval_id,
              DURATION=f"{seconds}.{rest:09}", **fields)


def main():
    point("event", "com.vantor.Calendar", "View", "Open", telemetry=True,
          STRING1_NAME="period", STRING1_VALUE="week",
          NUMBER1_NAME="events", NUMBER1_VALUE=12)
    with interval("com.vantor.Calendar", "View", "Load", telemetry=True):
        pass  # the work that is measured


if __name__ == "__main__":
    main()
