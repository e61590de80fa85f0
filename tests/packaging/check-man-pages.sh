#!/usr/bin/env bash
# Renders each generated man page as man would show it and fails on any warning (a broken
# macro, a line that cannot be filled at 80 columns, ...).
#   check-man-pages.sh PAGE...
set -euo pipefail
if ! command -v man >/dev/null; then
    echo "SKIP: man is not installed"
    exit 77
fi
[ $# -gt 0 ] || { echo "FAIL: no pages given"; exit 1; }
failed=0
for page in "$@"; do
    [ -s "$page" ] || { echo "FAIL: $page is missing or empty"; failed=1; continue; }
    warnings=$(MANWIDTH=80 LC_ALL=C.UTF-8 man --warnings -l "$page" 2>&1 >/dev/null) || true
    if [ -n "$warnings" ]; then
        echo "FAIL: $page:"
        echo "$warnings"
        failed=1
    fi
    # A page that renders to nothing would pass the above.
    grep -q "NAME" <<<"$(MANWIDTH=80 man -l "$page" 2>/dev/null)" || { echo "FAIL: $page has no NAME section"; failed=1; }
done
[ "$failed" -eq 0 ] && echo "rendered without warnings: $*"
exit "$failed"
