#!/bin/sh
# Installs the Debian packages that building and testing btbus need, when some
# are missing; with the argument ppc, also those of the PowerPC cross build and
# its sysroot. As root it runs apt-get; otherwise it prints the one line to run
# and fails. Safe to run again: it does nothing when everything is there.
set -eu

PACKAGES="cmake make g++ pkg-config
libdbus-1-dev dbus-daemon dbus-bin libdbus-glib-1-dev libdbus-glib-1-dev-bin libglib2.0-dev libbluetooth-dev libboost-dev
libgtest-dev libbenchmark-dev libcli11-dev nlohmann-json3-dev
python3-dbus python3-gi python3-dbusmock libglib2.0-bin util-linux systemd
doxygen graphviz dpkg-dev debhelper lintian"
if [ "${1:-}" = ppc ]; then
    PACKAGES="$PACKAGES g++-powerpc-linux-gnu qemu-user meson ninja-build autoconf automake libtool
googletest bzip2 xz-utils dpkg-dev"
fi

missing=""
for package in $PACKAGES; do
    if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q "install ok installed"; then
        missing="$missing $package"
    fi
done
[ -z "$missing" ] && exit 0

if [ "$(id -u)" -ne 0 ]; then
    echo "btbus needs these Debian packages; run as root:" >&2
    echo "  apt-get install -y$missing" >&2
    exit 1
fi
echo "installing:$missing"
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
# shellcheck disable=SC2086
apt-get install -y -qq $missing
