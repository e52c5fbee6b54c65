#!/bin/sh
# Checks the units of the service with systemd's own tool: that it understands them, and how exposed the service is.
#
#   systemd_units.sh SYSTEMD_ANALYZE SERVICE SOCKET
#
# Exit status 77: this systemd is too old for that.
set -eu

analyze=$1
service=$2
socket=$3

if ! "$analyze" --help | grep -q -e --offline; then
    echo "systemd_units: skipped: $analyze cannot judge units without a running systemd"
    exit 77
fi

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
trap 'exit 1' INT TERM

# The program need not be installed for that.
sed 's,^ExecStart=[^ ]*,ExecStart=/bin/true,' "$service" >"$work/qel-serve.service"
cp "$socket" "$work/qel-serve.socket"
"$analyze" verify "$work/qel-serve.service" "$work/qel-serve.socket" >"$work/said" 2>&1 || true
if grep -F "$work" "$work/said"; then
    echo "systemd_units: FAILED: systemd does not understand the units" >&2
    exit 1
fi

# At most 2.0 of 10.
"$analyze" security --offline=true --threshold=20 "$work/qel-serve.service" >"$work/said" 2>&1 || {
    cat "$work/said" >&2
    echo "systemd_units: FAILED: the service is too exposed" >&2
    exit 1
}
tail -1 "$work/said"
