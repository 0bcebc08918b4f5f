# Checks of an installed tree, shared by the install test and the package
# test; sourced. LD_LIBRARY_PATH, when set, is how the tree's programs find
# the library (a package's binaries have no run path of their own).

# The tree's bluez4-sim on private buses whose session bus starts the tree's
# btbus-scanner through the service file in $2; the tree's btbusctl lists
# the devices through it.
# Usage: scan_through_installed_scanner PREFIX SERVICE_DIR
scan_through_installed_scanner() {
    "$1/bin/bluez4-sim" --service-dir "$2" >"$1/sim.env" &
    sim=$!
    trap 'kill $sim 2>/dev/null; wait $sim 2>/dev/null || true' EXIT
    tries=0
    until [ "$(wc -l <"$1/sim.env")" -ge 2 ]; do
        tries=$((tries + 1))
        [ $tries -lt 200 ] && kill -0 $sim 2>/dev/null || { echo "the installed bluez4-sim did not come up"; exit 1; }
        sleep 0.05
    done
    found=$(. "$1/sim.env" && "$1/bin/btbusctl" --json scan --shared --timeout 3)
    echo "$found" | grep -q '"address":"00:0D:3C:A1:B2:C3"' ||
        { echo "the installed btbus-scanner listed no headset: $found"; exit 1; }
    kill $sim
    wait $sim || true
    trap - EXIT
    if left=$(pgrep -f "$1/bin/btbus-scanner"); then
        echo "the activated btbus-scanner outlived its session bus"
        kill $left
        exit 1
    fi
}

# A C++11 program of a user's, built against the tree through pkg-config and
# through the CMake package, and run.
# Usage: build_consumers PREFIX HERE CXX   (HERE: tests/install)
build_consumers() {
    pc=$(find "$1" -name btbus.pc)
    test -n "$pc" || { echo "btbus.pc was not installed"; exit 1; }
    libdir=$(PKG_CONFIG_PATH=$(dirname "$pc") pkg-config --variable=libdir btbus)
    # While the version is 0.x the soname carries the minor version as well.
    version=$(PKG_CONFIG_PATH=$(dirname "$pc") pkg-config --modversion btbus)
    expected=libbtbus.so.$(echo "$version" | cut -d. -f1)
    case $version in 0.*) expected=libbtbus.so.$(echo "$version" | cut -d. -f1-2) ;; esac
    soname=$(readelf -d "$libdir/libbtbus.so" | sed -n 's/.*SONAME.*\[\(.*\)\]/\1/p')
    test "$soname" = "$expected" || { echo "SONAME '$soname', not $expected"; exit 1; }
    # shellcheck disable=SC2046
    "$3" -std=c++11 -Wall -Wextra -Werror ${CXXFLAGS:-} -o "$1/consumer" "$2/consumer.cpp" \
        $(PKG_CONFIG_PATH=$(dirname "$pc") pkg-config --cflags --libs btbus)
    LD_LIBRARY_PATH=$libdir "$1/consumer"
    cmake -S "$2/cmake_consumer" -B "$1/cmake-consumer" -DCMAKE_PREFIX_PATH="$1" -DCMAKE_CXX_COMPILER="$3" >/dev/null
    cmake --build "$1/cmake-consumer" >/dev/null
    LD_LIBRARY_PATH=$libdir "$1/cmake-consumer/consumer"
}
