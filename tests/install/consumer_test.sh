#!/bin/sh
# Installs the build into a private prefix, where the checks of installed.sh
# run its programs with nothing but their own run path to find the library;
# then runs them again once the tree was moved.
# Usage: consumer_test.sh BUILD_DIR PREFIX CXX  (CXXFLAGS from the environment)
set -eu
build=$1 prefix=$2 cxx=$3
here=$(cd "$(dirname "$0")" && pwd)
unset LD_LIBRARY_PATH

rm -rf "$prefix" "$prefix.moved"
cmake --install "$build" --prefix "$prefix" >/dev/null
services=$prefix/share/dbus-1/services
grep -qx "Exec=$prefix/bin/btbus-scanner" "$services/com.quillmar.bluetooth.service" ||
    { echo "the scanner's session service file does not name the installed daemon"; exit 1; }

. "$here/installed.sh"
scan_through_installed_scanner "$prefix" "$services"
build_consumers "$prefix" "$here" "$cxx"
mv "$prefix" "$prefix.moved"
for program in btbusctl btbus-scanner; do
    "$prefix.moved/bin/$program" --help >/dev/null || { echo "the installed $program does not start once moved"; exit 1; }
done
