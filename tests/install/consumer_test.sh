#!/bin/sh
# Installs the build into a private prefix, then builds and runs a C++11 user
# program against it twice: through pkg-config and through the CMake package.
# Usage: consumer_test.sh BUILD_DIR PREFIX CXX  (CXXFLAGS from the environment)
set -eu
build=$1
prefix=$2
cxx=$3
here=$(cd "$(dirname "$0")" && pwd)

rm -rf "$prefix"
cmake --install "$build" --prefix "$prefix" >/dev/null
for header in connection object_path remote_object util variant fifo auto_connect server_object scanner_server scanner btbus; do
    test -f "$prefix/include/bluetooth/$header.h" || { echo "missing header $header.h"; exit 1; }
done
test -x "$prefix/bin/btbus-scanner" || { echo "btbus-scanner was not installed"; exit 1; }
grep -qx "Exec=.*/bin/btbus-scanner" "$prefix/share/dbus-1/services/com.quillmar.bluetooth.service" ||
    { echo "the scanner's session service file is missing or names no daemon"; exit 1; }
pc=$(find "$prefix" -name btbus.pc)
test -n "$pc" || { echo "btbus.pc was not installed"; exit 1; }
PKG_CONFIG_PATH=$(dirname "$pc")
export PKG_CONFIG_PATH
libdir=$(pkg-config --variable=libdir btbus)
soname=$(readelf -d "$libdir/libbtbus.so" | sed -n 's/.*SONAME.*\[\(.*\)\]/\1/p')
test "$soname" = libbtbus.so.0 || { echo "unexpected SONAME '$soname'"; exit 1; }

# shellcheck disable=SC2046
"$cxx" -std=c++11 -Wall -Wextra -Werror ${CXXFLAGS:-} -o "$prefix/consumer" "$here/consumer.cpp" $(pkg-config --cflags --libs btbus)
LD_LIBRARY_PATH=$libdir "$prefix/consumer"

cmake -S "$here/cmake_consumer" -B "$prefix/cmake-consumer" -DCMAKE_PREFIX_PATH="$prefix" \
      -DCMAKE_CXX_COMPILER="$cxx" >/dev/null
cmake --build "$prefix/cmake-consumer" >/dev/null
LD_LIBRARY_PATH=$libdir "$prefix/cmake-consumer/consumer"
