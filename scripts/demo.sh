#!/bin/sh
# A tour of btbus through btbusctl, against bluez4-sim on private buses: it
# never touches the host's buses, /etc or /tmp, and stops everything it
# started, also when interrupted. Usage: scripts/demo.sh BUILD_DIR
set -eu
top=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-build}" && pwd)

HEADSET=00:0D:3C:A1:B2:C3
KEYBOARD=00:12:A1:B0:00:42
PHONE=5C:F3:70:61:A0:17
ADAPTER=00:1A:7D:DA:71:13

step() {
    stop_if_interrupted
    printf '\n== %s\n' "$*"
}
# Shows the command line, then runs btbusctl.
btbusctl() {
    echo "\$ btbusctl $*"
    "$build/tools/btbusctl/btbusctl" "$@"
    stop_if_interrupted
}
interrupted=""
stop_if_interrupted() { [ -z "$interrupted" ] || exit 130; }

# The auto-connect step, run again by the demo in a private mount namespace.
if [ "${2:-}" = "--autoconnect" ]; then
    btbusctl autoconnect add "$HEADSET"
    btbusctl autoconnect enable
    echo "\$ cat /etc/bluetooth/autoconnect/$ADAPTER"
    cat "/etc/bluetooth/autoconnect/$ADAPTER"
    echo
    exit 0
fi

work=$(mktemp -d "$build/demo.XXXXXX")
sim=""
scan=""
finish() {
    status=$?
    trap - EXIT INT TERM
    [ -z "$interrupted" ] || { echo; echo "interrupted: stopping what the demo started"; status=130; }
    for pid in $scan $sim; do
        kill "$pid" 2>/dev/null || true
        wait "$pid" 2>/dev/null || true
    done
    rm -rf "$work"
    exit "$status"
}
trap finish EXIT
# Noted only: the shell goes on waiting for the command in the foreground,
# which Ctrl-C stops too, and stops at the next check.
trap 'interrupted=1' INT TERM

# Drives the simulator the way a radio neighbourhood would change.
simulator() {
    gdbus call --system --dest org.bluez --object-path /org/btbus/Simulator \
        --method "org.btbus.Simulator.$@" >/dev/null
}

step "Starting bluez4-sim, a simulated BlueZ 4 bluetoothd, on a private system and session bus"
# In a session of its own, so that Ctrl-C reaches the demo, which stops it last.
TMPDIR="$work" setsid "$top/tools/bluez4-sim/bluez4-sim" --round-seconds 0.5 \
    --service-dir "$build/share/dbus-1/services" >"$work/sim.env" 2>"$work/sim.err" &
sim=$!
tries=0
until [ "$(grep -c '^export ' "$work/sim.env" || true)" -ge 2 ]; do
    tries=$((tries + 1))
    if [ "$tries" -gt 200 ] || ! kill -0 "$sim" 2>/dev/null; then
        echo "bluez4-sim did not start:" >&2
        cat "$work/sim.err" >&2
        exit 1
    fi
    sleep 0.05
    stop_if_interrupted
done
. "$work/sim.env"
echo "(the host's buses, /etc and /tmp are never touched)"

step "The adapters, and every property of the default one"
btbusctl adapters
btbusctl show hci0

step "A scan: devices appear; the phone walks away and disappears"
echo "\$ btbusctl scan --timeout 4"
"$build/tools/btbusctl/btbusctl" scan --timeout 4 &  # not through the function: its PID
scan=$!
sleep 1.2
simulator SetInRange hci0 "$PHONE" false
wait "$scan"
scan=""

step "Pairing the keyboard: the library's agent answers its PIN request"
btbusctl pair "$KEYBOARD" --pin 0000

step "The headset: its services, audio connected, a volume key"
btbusctl create "$HEADSET"
btbusctl services "$HEADSET"
btbusctl audio connect "$HEADSET"
btbusctl volume up "$HEADSET"
btbusctl --json audio status "$HEADSET"

step "The devices the adapter knows now"
btbusctl devices

step "Auto-connect for the headset, in a private mount namespace: the host's /etc and /tmp stay untouched"
if unshare -m true 2>/dev/null; then
    mkdir "$work/mounts"
    "$top/scripts/in-private-mounts.sh" "$work/mounts" "$0" "$build" --autoconnect
    stop_if_interrupted
else
    echo "skipped: this machine allows no private mount namespace here (unshare -m needs root)"
fi

step "The phone is back: the devices seen through the scanner service, started by bus activation"
simulator SetInRange hci0 "$PHONE" true
btbusctl scan --shared --timeout 3

step "Done: stopping bluez4-sim, the scanner service and the buses"
