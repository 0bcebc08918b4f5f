#!/bin/sh
# Builds the Debian packages from a copy of the tree with the standard tools,
# checks them with lintian, unpacks them into a scratch root (nothing is
# installed on the host) and runs the checks of installed.sh there: the
# packaged programs, and a user's program built against the packaged -dev.
# Usage: package_test.sh SOURCE_DIR WORK_DIR CXX
set -eu
source=$1 work=$2 cxx=$3
here=$(cd "$(dirname "$0")" && pwd)
for tool in dpkg-buildpackage dh; do
    command -v $tool >/dev/null ||
        { echo "skipped: $tool is missing (apt-get install dpkg-dev debhelper, as make check does)"; exit 77; }
done

rm -rf "$work"
mkdir -p "$work/btbus"
tar -C "$source" --exclude='./build*' --exclude=./.git -cf - . | tar -C "$work/btbus" -xf -
(cd "$work/btbus" && dpkg-buildpackage -us -uc -b -j2) >"$work/build.log" 2>&1 ||
    { tail -n 40 "$work/build.log"; echo "dpkg-buildpackage failed"; exit 1; }
if command -v lintian >/dev/null; then
    lintian --fail-on error "$work"/btbus_*.changes
else
    echo "lintian is missing: the packages were not checked"
fi

root=$work/root
for deb in "$work"/*.deb; do dpkg-deb -x "$deb" "$root"; done
grep -qx "Exec=/usr/bin/btbus-scanner" "$root/usr/share/dbus-1/services/com.quillmar.bluetooth.service" ||
    { echo "the packaged service file does not name /usr/bin/btbus-scanner"; exit 1; }
# Installed in /usr the library needs no path; unpacked here, it does. The
# test's session bus starts the unpacked daemon in the packaged one's place.
library=$(find "$root" -name 'libbtbus.so.*' | head -n 1)
LD_LIBRARY_PATH=$(dirname "$library")
export LD_LIBRARY_PATH
mkdir -p "$work/services"
printf '[D-BUS Service]\nName=com.quillmar.bluetooth\nExec=/usr/bin/env LD_LIBRARY_PATH=%s %s\n' \
    "$LD_LIBRARY_PATH" "$root/usr/bin/btbus-scanner" >"$work/services/com.quillmar.bluetooth.service"

. "$here/../install/installed.sh"
scan_through_installed_scanner "$root/usr" "$work/services"
build_consumers "$root/usr" "$here/../install" "$cxx"
echo "packages built, checked and run: $(cd "$work" && echo *.deb)"
