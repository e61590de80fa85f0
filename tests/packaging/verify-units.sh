#!/usr/bin/env bash
# The systemd units of packaging/ as systemd reads them: systemd-analyze verify must accept
# all three without a word (a misspelt or misplaced directive is only a warning to systemd,
# and a unit with one would start with less protection than it says). ExecStart names the
# built daemon, since verify wants the program to exist. The man pages the units point to
# are checked by check-man-pages.sh.
#   verify-units.sh STOWLYD PACKAGING_DIR
set -euo pipefail
stowlyd=$1
packaging=$2
if ! command -v systemd-analyze >/dev/null; then
    echo "SKIP: systemd-analyze is not installed"
    exit 77
fi
work=$(mktemp -d /tmp/stowly-units-XXXXXX)
trap 'rm -rf "$work"' EXIT
units=(stowlyd.service stowlyd.socket stowlyd-upcall.socket)

# A unit that cannot fail tells whether verify runs here at all.
printf '[Service]\nExecStart=/bin/true\n' >"$work/probe.service"
if ! (cd "$work" && systemd-analyze verify --man=no ./probe.service) >"$work/probe.out" 2>&1; then
    echo "SKIP: systemd-analyze verify cannot run here:"
    cat "$work/probe.out"
    exit 77
fi
rm "$work/probe.service"

for unit in "${units[@]}"; do
    sed "s|/usr/libexec/stowlyd|$stowlyd|g" "$packaging/$unit" >"$work/$unit"
done
grep -q "^ExecStart=$stowlyd " "$work/stowlyd.service" || { echo "FAIL: stowlyd.service does not start $stowlyd"; exit 1; }
status=0
(cd "$work" && systemd-analyze verify --man=no "${units[@]/#/./}") >"$work/verify.out" 2>&1 || status=$?
if [ "$status" -ne 0 ] || [ -s "$work/verify.out" ]; then
    echo "FAIL: systemd-analyze verify (status $status):"
    cat "$work/verify.out"
    exit 1
fi
echo "verified: ${units[*]}"
