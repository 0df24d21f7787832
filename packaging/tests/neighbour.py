"""What another user does to the service in try-in-container: makes the run marker every 5 ms."""

import os
import time

while True:
    try:
        os.close(os.open("/var/tmp/tessel_reporter_running", os.O_CREAT | os.O_WRONLY, 0o666))
    except OSError:  # somebody else's stands there
        pass
    time.sleep(0.005)
