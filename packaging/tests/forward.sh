# shellcheck shell=sh
# shellcheck disable=SC2154 # $root is that of try-in-container
# Sourced by try-in-container: the forwarder without an address, with settings from a drop-in and a file, and at work.

echo "# forward"
check "apt installs the forwarder" inside apt-get install -y -qq /trial/forwarder.deb
check "it is disabled" equals "$(inside systemctl is-enabled statora-forwarder.service)" disabled
inside systemctl start statora-forwarder.service 2> /dev/null || true
says_what_is_missing() {
    inside journalctl -q -o cat -u statora-forwarder.service |
        grep -q '^OTEL_EXPORTER_OTLP_ENDPOINT is not set: .*/etc/statora/forwarder.env'
}
check "without an endpoint it says what is missing" eventually says_what_is_missing
check "and is not started again" \
    equals "$(property statora-forwarder.service ActiveState) $(property statora-forwarder.service NRestarts)" "failed 0"
inside systemctl reset-failed statora-forwarder.service
inside systemd-run --quiet --unit=collector python3 /trial/collector.py /trial/received
check "a collector listens" eventually test -s "$root/trial/received.port"
mkdir -p "$root/etc/systemd/system/statora-forwarder.service.d"
printf '[Service]\nEnvironment=OTEL_EXPORTER_OTLP_ENDPOINT=http://127.0.0.1:%s TESSEL_FORWARD_SPREAD=0\n' \
    "$(cat "$root/trial/received.port")" > "$root/etc/systemd/system/statora-forwarder.service.d/own.conf"
inside systemctl daemon-reload
echo TESSEL_FORWARD_RATE=0 > "$root/etc/statora/forwarder.env"
waiting=$(spool 'SELECT count(*) FROM events')
check "with one in a drop-in it does" inside systemctl enable --now statora-forwarder.service
drained() { [ "$(spool 'SELECT count(*) FROM events')" = 0 ]; }
check "the spool drains" eventually drained
check "the collector has each record" \
    equals "$(awk '{sum += $1} END {print sum}' "$root/trial/received")" "$waiting"
check "the reporter still writes" run_service
inside systemctl stop collector.service
echo "        exposure: $(inside systemd-analyze security statora-forwarder.service --no-pager | tail -n 1 | tr -d '\n')"
