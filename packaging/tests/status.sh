# shellcheck shell=sh
# shellcheck disable=SC2154 # $root and $marker are those of try-in-container
# Sourced by try-in-container: the unit that looks whether all is well, once with metrics, and what the
# status tells whom.

mkdir -p "$root/etc/systemd/system/tessel-status.service.d"
printf '[Service]\nEnvironment="TESSEL_STATUS_OPTIONS=--prometheus /srv/metrics/tessel.prom"\nReadWritePaths=/srv/metrics\n' \
    > "$root/etc/systemd/system/tessel-status.service.d/metrics.conf"
inside install -d -o tessel-reporter /srv/metrics
inside systemctl daemon-reload
check "its unit is sound" inside systemd-analyze verify --man=no tessel-status.service tessel-status.timer
check "the timer of the status waits" inside systemctl is-active tessel-status.timer
check "the status unit looks" inside systemctl start tessel-status.service
check "it keeps what it found" inside grep -F '"good":true' /var/lib/tessel/status.json
check "as the service's user" equals "$(inside stat -c '%U %G %a' /var/lib/tessel/status.json)" "tessel-reporter tessel-reporter 640"
check "metrics are for everyone" equals "$(inside stat -c '%a' /srv/metrics/tessel.prom)" 644
check "and agree" inside grep -Fx 'tessel_good 1' /srv/metrics/tessel.prom
inside rm -r /srv/metrics /etc/systemd/system/tessel-status.service.d
inside systemctl daemon-reload

tells_whose_marker() { inside tesselctl status --json | grep -F "\"path\":\"$marker\",\"state\":\"absent\""; }
check "it tells which marker it looked for" tells_whose_marker
tells_a_user() {
    inside setpriv --reuid=nobody --regid=tessel-reporter --clear-groups tesselctl status --json |
        grep '"state":"cannot_be_seen"'
}
check "and says so where it may not look" tells_a_user
