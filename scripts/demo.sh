#!/bin/sh
# Starts the BlueZ 4 simulator on private buses, runs the demo program against
# it, and stops everything it started. Usage: scripts/demo.sh BUILD_DIR
set -eu
top=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-build}" && pwd)
work=$(mktemp -d "$build/demo.XXXXXX")
sim=""
finish() {
    if [ -n "$sim" ]; then kill "$sim" 2>/dev/null || true; wait "$sim" 2>/dev/null || true; fi
    rm -rf "$work"
}
trap finish EXIT INT TERM

TMPDIR="$work" "$top/tools/bluez4-sim/bluez4-sim" >"$work/sim.out" 2>"$work/sim.err" &
sim=$!
tries=0
until [ "$(grep -c '^export ' "$work/sim.out" || true)" -ge 2 ]; do
    tries=$((tries + 1))
    if [ "$tries" -gt 200 ] || ! kill -0 "$sim" 2>/dev/null; then
        echo "bluez4-sim did not start:" >&2
        cat "$work/sim.err" >&2
        exit 1
    fi
    sleep 0.05
done
eval "$(grep '^export ' "$work/sim.out")"
echo "bluez4-sim is running on private buses:"
grep '^export ' "$work/sim.out" | sed 's/^/  /'
echo
"$build/examples/btbus-demo"
