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

. "$here/installed.sh"
scan_through_installed_scanner "$prefix" "$services"
build_consumers "$prefix" "$here" "$cxx"
