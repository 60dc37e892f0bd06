#!/usr/bin/env bash
# Installs into a staging prefix, moves the tree elsewhere (the install must
# be relocatable), builds out-of-tree host programs against it with
# pkg-config and with find_package, in both ways a host uses the library
# (with libptzhost; with its own host services), and runs them. Then builds
# the Debian packages and checks their contents and dependencies.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
build=$(cd "$root/${BUILD_DIR:-build}" && pwd)
work=$(mktemp -d /tmp/ptzinstall.XXXXXX)
pgdir=$(mktemp -d /tmp/ptzpg.XXXXXX)
cleanup() {
  "$root/scripts/pg_cluster.sh" stop "$pgdir" >/dev/null 2>&1 || true
  rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "install check: $*" >&2; exit 1; }

# 1. Staged install, then moved: nothing may point back at the first prefix.
cmake --install "$build" --prefix "$work/first" >/dev/null
mv "$work/first" "$work/prefix"
prefix="$work/prefix"
! grep -rIl "$work/first" "$prefix" || fail "installed files name the install prefix"
libdir=$(dirname "$(find "$prefix" -name 'libptzpatrol.so' | head -n 1)")
export PKG_CONFIG_PATH="$libdir/pkgconfig" LD_LIBRARY_PATH="$libdir"
src="$root/tests/install/consumer"

"$root/scripts/pg_cluster.sh" start "$pgdir" >/dev/null
export PGHOST="$pgdir" PGUSER=ptz PGDATABASE=ptztest

# 2. pkg-config, both ways.
mkdir -p "$work/pc"
# shellcheck disable=SC2046
g++ -std=c++17 -o "$work/pc/with_ptzhost" "$src/with_ptzhost.cpp" $(pkg-config --cflags --libs ptzhost)
# shellcheck disable=SC2046
g++ -std=c++17 -o "$work/pc/own_host" "$src/own_host.cpp" $(pkg-config --cflags --libs ptzpatrol)
readelf -d "$work/pc/own_host" | grep -q 'libptzhost' && fail "own_host links libptzhost"
"$work/pc/with_ptzhost"
"$work/pc/own_host"

# 3. find_package, both ways.
cmake -S "$src" -B "$work/cm" -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$work/cm" -j"${JOBS:-2}" >/dev/null
readelf -d "$work/cm/own_host" | grep -q 'libptzhost' && fail "own_host links libptzhost (CMake)"
"$work/cm/with_ptzhost"
"$work/cm/own_host"

# 4. Debian packages: contents and dependencies.
PACKAGE_BUILD_DIR="${BUILD_DIR:-build}-deb" "$root/scripts/package.sh" "$work/deb" >/dev/null
deb() { find "$work/deb" -maxdepth 1 -name "$1_*.deb" | head -n 1; }
runtime=$(deb libptzpatrol0) dev=$(deb libptzpatrol-dev) tools=$(deb ptzpatrol)
[ -n "$runtime" ] && [ -n "$dev" ] && [ -n "$tools" ] || fail "missing packages: $(ls "$work/deb")"
for p in "$runtime" "$dev" "$tools"; do dpkg-deb -x "$p" "$work/root"; done
has() { [ -e "$work/root/$1" ] || fail "no $1 in the packages"; }
ma=$(dpkg-architecture -qDEB_HOST_MULTIARCH)
has "usr/lib/$ma/libptzpatrol.so.0"
has "usr/lib/$ma/libptzhost.so.0"
has "usr/lib/$ma/libptzpatrol.so"
has "usr/lib/$ma/pkgconfig/ptzpatrol.pc"
has "usr/lib/$ma/pkgconfig/ptzhost.pc"
has "usr/lib/$ma/cmake/ptzpatrol/ptzpatrolConfig.cmake"
has "usr/include/ptzpatrol/patrol/patrol.h"
has "usr/include/ptzpatrol/host/database.h"
has "usr/share/ptzpatrol/schema.sql"
# The service and its systemd unit come with the tool, in the ptzpatrol package.
listing=$(dpkg-deb -c "$tools")
for f in usr/bin/ptzpatrol usr/sbin/ptzpatrold usr/lib/systemd/system/ptzpatrold.service; do
  grep -q " \./$f\$" <<<"$listing" || fail "no $f in the ptzpatrol package"
done
unit="$work/root/usr/lib/systemd/system/ptzpatrold.service"
grep -q '^ExecStart=/usr/sbin/ptzpatrold ' "$unit" || fail "the unit does not start /usr/sbin/ptzpatrold"
grep -q '^Restart=on-failure$' "$unit" || fail "the unit does not restart the service on failure"
LD_LIBRARY_PATH="$work/root/usr/lib/$ma" "$work/root/usr/sbin/ptzpatrold" --help >/dev/null ||
  fail "the packaged ptzpatrold does not run"
if command -v systemd-analyze >/dev/null; then
  # The unit's own syntax (the binary it names is checked above).
  sed "s#/usr/sbin/ptzpatrold#$work/root/usr/sbin/ptzpatrold#" "$unit" >"$work/ptzpatrold.service"
  verify=$(systemd-analyze verify "$work/ptzpatrold.service" 2>&1) || fail "systemd-analyze verify: $verify"
  [ -z "$verify" ] || fail "systemd-analyze verify: $verify"
fi
dpkg-deb -c "$runtime" | grep -q '\.h$' && fail "headers in the runtime package"
dpkg-deb -c "$runtime" | grep -q 'libptzpatrol.so$' && fail "the development link in the runtime package"
depends() { dpkg-deb -f "$1" Depends; }
for want in libc6 'libstdc\+\+6' libpq5 libcurl4 libpugixml1v5 libssl3; do
  depends "$runtime" | grep -Eq "(^|, )$want( |,|$)" || fail "runtime package does not depend on $want: $(depends "$runtime")"
done
depends "$dev" | grep -q 'libptzpatrol0 (= ' || fail "dev package does not depend on the runtime: $(depends "$dev")"
depends "$tools" | grep -q 'libptzpatrol0' || fail "tools package does not depend on the runtime: $(depends "$tools")"
# The packaged libraries are complete: a host links them from the scratch root.
g++ -std=c++17 -o "$work/deb_host" "$src/with_ptzhost.cpp" -I"$work/root/usr/include/ptzpatrol" \
  -L"$work/root/usr/lib/$ma" -lptzpatrol -lptzhost
LD_LIBRARY_PATH="$work/root/usr/lib/$ma" "$work/deb_host"
echo "install check: passed"
