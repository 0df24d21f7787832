# shellcheck shell=sh
# Sourced by try-in-container: the installed service reads what a service with a log namespace of its own
# recorded. A daemon of its own keeps that beside the files of the main one.

echo "# a service with a log namespace of its own"
inside systemd-run --wait --quiet --property=LogNamespace=web sh -c 'printf "%s\n" PRIORITY=7 TESSEL_KIND=event \
    TESSEL_SUBSYSTEM=com.vantor.Calendar TESSEL_CATEGORY=View TESSEL_NAME=Web TESSEL_TELEMETRY=1 | logger --journald'
inside journalctl --namespace=web --sync
check "a run ends" run_service
check "and reports its trace point" equals "$(rows ts__com.vantor.Calendar__View__Web)" 1
# Otherwise all later runs would report the point again.
inside systemctl stop 'systemd-journald@web.*'
inside sh -c 'rm -r /*/log/journal/*.web'
