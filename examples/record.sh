#!/bin/sh
# Records an event and an interval from a shell, through logger(1).
#
# Each logger is a process of its own, so an interval needs system scope and an id. The journal daemon
# looks up the program behind an entry when it reads it: a process as short as this may be gone by
# then, and the trace point is reported under "Unknown".
set -eu

# record KIND NAME [FIELD=VALUE]...: fields by their names without TESSEL_.
record() {
    kind=$1 name=$2
    shift 2
    {
        printf '%s\n' PRIORITY=7 TESSEL_SUBSYSTEM=com.vantor.Calendar TESSEL_CATEGORY=View \
            TESSEL_TELEMETRY=1 "TESSEL_KIND=$kind" "TESSEL_NAME=$name"
        for field; do printf 'TESSEL_%s\n' "$field"; done
    } | logger --journald
}

record event Open STRING1_NAME=period STRING1_VALUE=week NUMBER1_NAME=events NUMBER1_VALUE=12

id=$$-$(date +%s%N)
record begin Load INTERVAL_SCOPE=system "INTERVAL_ID=$id"
# ... the work that is measured ...
record end Load INTERVAL_SCOPE=system "INTERVAL_ID=$id"
