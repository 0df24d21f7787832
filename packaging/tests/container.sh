# shellcheck shell=sh
# Sourced by try-in-container, with $root and $trial set: a container that boots, and checks that are
# counted in $checks and $failures.

# --- The container --------------------------------------------------------------------------------

leader= # the container's first process
nspawn=
failures=0
checks=0

# Runs a command in the container.
inside() {
    nsenter --target "$leader" --mount --uts --ipc --pid --cgroup --root --wd -- \
        env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin HOME=/root TERM=dumb DEBIAN_FRONTEND=noninteractive "$@"
}

# The control groups of a container are below those of the process that starts it. Two containers that are
# started from the same ones would share the group of each service.
cgroup=tessel-trial-$$
cgroup_trees() { find /sys/fs/cgroup /sys/fs/cgroup/systemd /sys/fs/cgroup/unified -maxdepth 1 -name cgroup.procs -printf '%h\n' 2> /dev/null | sort -u; }
in_own_cgroup() {
    for tree in $(cgroup_trees); do
        mkdir -p "$tree/$cgroup"
        echo 0 > "$tree/$cgroup/cgroup.procs"
    done
    exec "$@"
}

boot() {
    in_own_cgroup systemd-nspawn --quiet --boot --register=no --keep-unit --directory="$root" --machine=tessel-trial \
        --resolv-conf=replace-host > "$trial/console" 2>&1 < /dev/null &
    nspawn=$!
    for _ in $(seq 300); do
        leader=$(pgrep -P "$nspawn" -o || true)
        if [ "$leader" ] && inside systemctl is-system-running 2> /dev/null |
            grep -qE 'running|degraded'; then
            return 0
        fi
        sleep 0.1
    done
    cat "$trial/console"
    echo "the container does not boot"
    exit 1
}

power_off() {
    if [ "$leader" ]; then kill -s RTMIN+14 "$leader" 2> /dev/null || true; fi
    if [ "$nspawn" ]; then wait "$nspawn" 2> /dev/null || true; fi
    leader=
    nspawn=
    for tree in $(cgroup_trees); do find "$tree/$cgroup" -depth -type d -exec rmdir {} + 2> /dev/null || true; done
}

# --- Checks ---------------------------------------------------------------------------------------

# check WORDS COMMAND...: the command, run here, must succeed.
check() {
    words=$1
    shift
    checks=$((checks + 1))
    if "$@" > "$trial/output" 2>&1; then
        echo "ok      $words"
    else
        failures=$((failures + 1))
        echo "FAILED  $words"
        sed 's/^/        /' "$trial/output" | tail -n 20
        if [ "$leader" ]; then
            inside journalctl --no-pager -q -n 8 -o cat -u 'tessel-reporter*' -u statora-forwarder 2>&1 |
                cut -c 1-160 | sed 's/^/        | /'
        fi
    fi
}

equals() {
    if [ "$1" = "$2" ]; then return 0; fi
    printf 'is:     %s\nshould: %s\n' "$1" "$2"
    return 1
}

# eventually COMMAND...: until it succeeds, for three minutes.
eventually() {
    for _ in $(seq 900); do
        if "$@" > /dev/null 2>&1; then return 0; fi
        sleep 0.2
    done
    "$@"
}
