#!/bin/sh
# Records an event and an interval from a shell. One tesselctl takes the points of the whole script, a
# JSON object a line; what they have in common stands on its command line. Reports name tesselctl as
# the process of these points.
set -eu
exec 3>&1 # the script's own output: inside the braces, standard output goes to tesselctl

{
    echo '{"name": "Open", "string1": {"period": "week"}, "number1": {"events": 12}}'

    echo '{"kind": "begin", "name": "Load", "id": 1}'
    echo "... the work that is measured ..." >&3
    echo '{"kind": "end", "name": "Load", "id": 1}'
} | tesselctl record --stdin --subsystem com.vantor.Calendar --category View --telemetry
