#!/bin/sh
# Prints the path of a powerpc-linux-gnu sysroot that holds what btbus, its
# tools and its tests link against on the appliance's processor: zlib, expat,
# libffi, pcre2, libdbus-1, GLib, dbus-glib and BlueZ's libbluetooth, built
# from Debian's source packages with Debian's cross compiler, and GoogleTest
# built from the host's /usr/src/googletest; CLI11, nlohmann-json and Boost
# are header-only and shared with the host.
#
# The sysroot is kept in a cache outside the checkout, named after a hash of
# this recipe and of the source versions, and built aside and renamed into
# place, so that a run that is killed never leaves half a sysroot behind.
# BTBUS_CACHE sets the cache (default: ~/.cache/btbus). The sources come from
# deb.debian.org through an apt setup of this script's own: the machine's apt
# sources, state and cache are not touched.
set -eu

cache=${BTBUS_CACHE:-${XDG_CACHE_HOME:-$HOME/.cache}/btbus}
host=powerpc-linux-gnu
here=$(cd "$(dirname "$0")" && pwd)
toolchain=$here/../cmake/cross-toolchain.cmake
# bookworm's dbus-glib source is gone from the mirror; trixie's upstream
# tarball builds the same library.
packages="zlib/bookworm expat/bookworm libffi/bookworm pcre2/bookworm dbus/bookworm glib2.0/bookworm dbus-glib/trixie bluez/bookworm"
mkdir -p "$cache"
work=$(mktemp -d "$cache/.sysroot-work.XXXXXX")
trap 'rm -rf "$work"' EXIT
say() { echo "ppc-sysroot: $*" >&2; }

# ---- the sources, through apt state of our own ----
apt="$work/apt"
mkdir -p "$apt/lists/partial" "$apt/cache/archives/partial" "$apt/parts" "$apt/preferences.d"
printf 'deb-src http://deb.debian.org/debian bookworm main\ndeb-src http://deb.debian.org/debian trixie main\n' \
    >"$apt/sources.list"
aptget() {
    apt-get -q -o Dir::Etc::SourceList="$apt/sources.list" -o Dir::Etc::SourceParts="$apt/parts" \
        -o Dir::Etc::Preferences="$apt/preferences" -o Dir::Etc::PreferencesParts="$apt/preferences.d" \
        -o Dir::State="$apt" -o Dir::State::Lists="$apt/lists" -o Dir::State::status=/dev/null \
        -o Dir::Cache="$apt/cache" -o Debug::NoLocking=1 -o APT::Sandbox::User=root "$@"
}
# shellcheck disable=SC2086
if ! aptget update >"$work/apt.log" 2>&1 || ! aptget source --print-uris $packages >"$work/uris" 2>>"$work/apt.log"; then
    newest=$(ls -dt "$cache"/ppc-sysroot-* 2>/dev/null | head -n 1 || true)
    [ -n "$newest" ] || { cat "$work/apt.log" >&2; say "cannot reach Debian's sources and has no sysroot yet"; exit 1; }
    say "cannot reach Debian's sources: using $newest"
    echo "$newest"
    exit 0
fi
key=$( (cat "$0" "$toolchain"; grep -o "[^/' ]*\.dsc'" "$work/uris" | sort) | sha256sum | cut -c1-16)
sysroot="$cache/ppc-sysroot-$key"
if [ -d "$sysroot" ]; then
    echo "$sysroot"
    exit 0
fi
say "building $sysroot (about five minutes on two cores)"
mkdir -p "$work/src"
# The upstream tarballs are what is built; a missing Debian diff is no matter.
# shellcheck disable=SC2086
(cd "$work/src" && aptget source --download-only $packages >>"$work/apt.log" 2>&1) || true
for package in zlib expat libffi pcre2 dbus glib2.0 dbus-glib bluez; do
    tarball=$(ls "$work/src/${package}_"*.orig.tar.* 2>/dev/null | grep -v '\.asc$' | grep -v 'orig-' | head -n 1)
    [ -n "$tarball" ] || { cat "$work/apt.log" >&2; say "no source of $package"; exit 1; }
    mkdir "$work/src/$package"
    tar -xf "$tarball" -C "$work/src/$package" --strip-components=1
done

# ---- the build ----
root="$work/sysroot"
mkdir -p "$root/usr/lib/pkgconfig" "$root/usr/include" "$root/usr/share/cmake"
jobs=$(nproc)
export PKG_CONFIG_LIBDIR="$root/usr/lib/pkgconfig:$root/usr/share/pkgconfig" PKG_CONFIG_SYSROOT_DIR="$root"
export CPPFLAGS="-I$root/usr/include" LDFLAGS="-L$root/usr/lib -Wl,-rpath-link,$root/usr/lib"
export CC=$host-gcc CXX=$host-g++
configure="--host=$host --build=$(gcc -dumpmachine) --prefix=/usr --libdir=/usr/lib --disable-static"
step() {
    name=$1
    shift
    say "$name"
    if ! (cd "$work/src/$name" && "$@") >"$work/$name.log" 2>&1; then
        tail -n 30 "$work/$name.log" >&2
        say "$name failed"
        exit 1
    fi
    # libtool archives name /usr/lib: the next builds would look on the host.
    rm -f "$root"/usr/lib/*.la
}
# shellcheck disable=SC2086
step zlib sh -c "CHOST=$host ./configure --prefix=/usr --libdir=/usr/lib && make -j$jobs \
    && make install DESTDIR=$root"
# shellcheck disable=SC2086
step expat sh -c "cd expat && autoreconf -fi && ./configure $configure --without-docbook --without-examples \
    --without-tests --without-xmlwf && make -j$jobs && make install DESTDIR=$root"
# shellcheck disable=SC2086
step libffi sh -c "./configure $configure --disable-docs && make -j$jobs && make install DESTDIR=$root"
# shellcheck disable=SC2086
step pcre2 sh -c "./configure $configure && make -j$jobs libpcre2-8.la && make install-libLTLIBRARIES \
    install-pkgconfigDATA install-includeHEADERS install-nodist_includeHEADERS DESTDIR=$root"
# The library only: no daemon, tools, tests or documents.
# shellcheck disable=SC2086
step dbus sh -c "./configure $configure --disable-tests --disable-modular-tests --disable-installed-tests \
    --without-x --disable-x11-autolaunch --disable-systemd --disable-selinux --disable-apparmor \
    --disable-libaudit --disable-inotify --disable-doxygen-docs --disable-xml-docs --disable-ducktype-docs \
    --disable-embedded-tests --disable-asserts && make -j$jobs -C dbus libdbus-1.la \
    && make -C dbus install-libLTLIBRARIES install-dbusincludeHEADERS install-nodist_dbusarchincludeHEADERS \
       DESTDIR=$root && make install-pkgconfigDATA DESTDIR=$root"
# meson runs what it builds for the target under qemu.
cat >"$work/meson-cross.ini" <<EOF
[binaries]
c = '$host-gcc'
cpp = '$host-g++'
ar = '$host-ar'
strip = '$host-strip'
pkgconfig = 'pkg-config'
exe_wrapper = ['qemu-ppc', '-L', '/usr/$host', '-E', 'LD_LIBRARY_PATH=$root/usr/lib']

[host_machine]
system = 'linux'
cpu_family = 'ppc'
cpu = 'ppc'
endian = 'big'

[built-in options]
c_args = ['-I$root/usr/include']
c_link_args = ['-L$root/usr/lib', '-Wl,-rpath-link,$root/usr/lib']
EOF
step glib2.0 sh -c "unset CC CXX CPPFLAGS LDFLAGS; meson setup --cross-file $work/meson-cross.ini --prefix=/usr \
    --libdir=lib --buildtype=release -Dselinux=disabled -Dxattr=false -Dlibmount=disabled -Dman=false \
    -Dgtk_doc=false -Dtests=false -Dinstalled_tests=false -Dnls=disabled -Dlibelf=disabled -Dsysprof=disabled \
    -Ddtrace=false -Dsystemtap=false -Dglib_debug=disabled -Dmultiarch=false _build \
    && ninja -C _build -j$jobs && DESTDIR=$root meson install -C _build --no-rebuild"
# The host's binding tool and marshaller generator; the library only.
# shellcheck disable=SC2086
step dbus-glib sh -c "./configure $configure --disable-tests --disable-gtk-doc \
    --with-dbus-binding-tool=/usr/bin/dbus-binding-tool GLIB_GENMARSHAL=/usr/bin/glib-genmarshal \
    && make -j$jobs -C dbus-gmain libdbus-gmain.la && make -j$jobs -C dbus libdbus-glib-1.la \
    && make -C dbus install-libLTLIBRARIES install-libdbus_glibHEADERS DESTDIR=$root \
    && make install-pkgconfigDATA DESTDIR=$root"
# libbluetooth's four sources, as BlueZ's own build links them (version-info 22:8:19).
step bluez sh -c "mkdir -p $root/usr/include/bluetooth config && : >config/config.h \
    && cp lib/bluetooth.h lib/hci.h lib/hci_lib.h lib/sco.h lib/l2cap.h lib/sdp.h lib/sdp_lib.h lib/rfcomm.h \
          lib/bnep.h lib/cmtp.h lib/hidp.h $root/usr/include/bluetooth/ \
    && $host-gcc -O2 -fPIC -shared -Iconfig -I. -Ilib -Wl,-soname,libbluetooth.so.3 \
          -o $root/usr/lib/libbluetooth.so.3.19.8 lib/bluetooth.c lib/hci.c lib/sdp.c lib/uuid.c \
    && ln -s libbluetooth.so.3.19.8 $root/usr/lib/libbluetooth.so.3 \
    && ln -s libbluetooth.so.3 $root/usr/lib/libbluetooth.so \
    && sed -e 's|@prefix@|/usr|;s|@exec_prefix@|\${prefix}|;s|@libdir@|\${exec_prefix}/lib|' \
           -e 's|@includedir@|\${prefix}/include|;s|@VERSION@|5.66|' lib/bluez.pc.in \
           >$root/usr/lib/pkgconfig/bluez.pc"
mkdir -p "$work/src/googletest"
step googletest sh -c "unset CC CXX CPPFLAGS LDFLAGS; cmake -S /usr/src/googletest -B build \
    -DCMAKE_TOOLCHAIN_FILE=$toolchain -DBTBUS_SYSROOT=$root -DBTBUS_CROSS_PREFIX=$host- \
    -DCMAKE_INSTALL_PREFIX=/usr -DCMAKE_INSTALL_LIBDIR=lib -DCMAKE_BUILD_TYPE=Release \
    && cmake --build build -j$jobs && DESTDIR=$root cmake --install build"
# Header-only: copied (small) or linked (Boost).
cp -r /usr/include/CLI /usr/include/nlohmann "$root/usr/include/"
cp -r /usr/share/cmake/CLI11 /usr/share/cmake/nlohmann_json "$root/usr/share/cmake/"
ln -s /usr/include/boost "$root/usr/include/boost"

# A run beside this one may have finished first: its sysroot is as good.
mv -T "$root" "$sysroot" 2>/dev/null || [ -d "$sysroot" ]
say "done: $(du -sh "$sysroot" | cut -f1)"
echo "$sysroot"
