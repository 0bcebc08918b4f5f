#!/bin/sh
# Installs the build into a private prefix; runs the installed programs from
# it, the scanner daemon started by the session bus, with nothing but their
# own run path to find the library (also after the tree was moved); then builds
# and runs a C++11 user program against it twice: through pkg-config and
# through the CMake package.
# Usage: consumer_test.sh BUILD_DIR PREFIX CXX  (CXXFLAGS from the environment)
set -eu
build=$1
prefix=$2
cxx=$3
here=$(cd "$(dirname "$0")" && pwd)
unset LD_LIBRARY_PATH

rm -rf "$prefix" "$prefix.moved"
cmake --install "$build" --prefix "$prefix.moved" >/dev/null
mv "$prefix.moved" "$prefix"
for program in btbusctl btbus-scanner; do
    "$prefix/bin/$program" --help >/dev/null || { echo "the installed $program does not start once moved"; exit 1; }
done
rm -rf "$prefix"
cmake --install "$build" --prefix "$prefix" >/dev/null
for header in connection object_path remote_object util variant fifo auto_connect server_object scanner_server scanner btbus; do
    test -f "$prefix/include/bluetooth/$header.h" || { echo "missing header $header.h"; exit 1; }
done
services=$prefix/share/dbus-1/services
grep -qx "Exec=$prefix/bin/btbus-scanner" "$services/com.quillmar.bluetooth.service" ||
    { echo "the scanner's session service file does not name the installed daemon"; exit 1; }

# The installed simulator on private buses whose session bus starts the
# installed btbus-scanner for btbusctl's scan through the scanner service.
"$prefix/bin/bluez4-sim" --service-dir "$services" >"$prefix/sim.env" &
sim=$!
trap 'kill $sim 2>/dev/null; wait $sim 2>/dev/null || true' EXIT
tries=0
until [ "$(wc -l <"$prefix/sim.env")" -ge 2 ]; do
    tries=$((tries + 1))
    [ $tries -lt 200 ] && kill -0 $sim 2>/dev/null || { echo "the installed bluez4-sim did not come up"; exit 1; }
    sleep 0.05
done
found=$(. "$prefix/sim.env" && "$prefix/bin/btbusctl" --json scan --shared --timeout 3)
echo "$found" | grep -q '"address":"00:0D:3C:A1:B2:C3"' ||
    { echo "the installed btbus-scanner listed no headset: $found"; exit 1; }
kill $sim
wait $sim || true
trap - EXIT
if pgrep -f "$prefix/bin/btbus-scanner" >/dev/null; then
    echo "the activated btbus-scanner outlived its session bus"
    pkill -f "$prefix/bin/btbus-scanner"
    exit 1
fi

pc=$(find "$prefix" -name btbus.pc)
test -n "$pc" || { echo "btbus.pc was not installed"; exit 1; }
PKG_CONFIG_PATH=$(dirname "$pc")
export PKG_CONFIG_PATH
libdir=$(pkg-config --variable=libdir btbus)
# While the version is 0.x the soname carries the minor version as well.
version=$(pkg-config --modversion btbus)
expected=libbtbus.so.$(echo "$version" | cut -d. -f1)
case $version in 0.*) expected=libbtbus.so.$(echo "$version" | cut -d. -f1-2) ;; esac
soname=$(readelf -d "$libdir/libbtbus.so" | sed -n 's/.*SONAME.*\[\(.*\)\]/\1/p')
test "$soname" = "$expected" || { echo "SONAME '$soname', not $expected"; exit 1; }

# shellcheck disable=SC2046
"$cxx" -std=c++11 -Wall -Wextra -Werror ${CXXFLAGS:-} -o "$prefix/consumer" "$here/consumer.cpp" $(pkg-config --cflags --libs btbus)
LD_LIBRARY_PATH=$libdir "$prefix/consumer"

cmake -S "$here/cmake_consumer" -B "$prefix/cmake-consumer" -DCMAKE_PREFIX_PATH="$prefix" \
      -DCMAKE_CXX_COMPILER="$cxx" >/dev/null
cmake --build "$prefix/cmake-consumer" >/dev/null
LD_LIBRARY_PATH=$libdir "$prefix/cmake-consumer/consumer"
