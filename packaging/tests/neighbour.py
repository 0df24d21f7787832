"""What another user does to the service in try-in-container: neighbour.py touch | flood COUNT."""

import os
import socket
import sys
import time


def touch():
    """Makes the run marker every 5 ms."""
    while True:
        try:
            os.close(os.open("/var/tmp/tessel_reporter_running", os.O_CREAT | os.O_WRONLY, 0o666))
        except OSError:  # somebody else's stands there
            pass
        time.sleep(0.005)


def flood(count):
    """Records so many trace points that may be reported."""
    journal = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
    fields = {"PRIORITY": 7, "TESSEL_KIND": "event", "TESSEL_SUBSYSTEM": "com.vantor.Junk",
              "TESSEL_CATEGORY": "Flood", "TESSEL_NAME": "Junk", "TESSEL_TELEMETRY": 1}
    entry = "".join(f"{key}={value}\n" for key, value in fields.items()).encode()
    for _ in range(count):
        journal.sendto(entry, "/run/systemd/journal/socket")


if sys.argv[1] == "touch":
    touch()
else:
    flood(int(sys.argv[2]))
