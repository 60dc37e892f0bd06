#!/usr/bin/env bash
# Builds the Debian packages (libptzpatrol0, libptzpatrol-dev, ptzpatrol) in
# their own build directory, configured for /usr, into OUTDIR (default dist/).
#   scripts/package.sh [OUTDIR]
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
out=$(mkdir -p "${1:-$root/dist}" && cd "${1:-$root/dist}" && pwd)
build="$root/${PACKAGE_BUILD_DIR:-build-deb}"
"$root/scripts/deps.sh"
cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_INSTALL_PREFIX=/usr \
  -DBUILD_TESTING=OFF -DPTZ_BUILD_BENCH=OFF >/dev/null
cmake --build "$build" -j"${JOBS:-$(nproc)}"
(cd "$build" && cpack -G DEB -B "$out" >/dev/null)
rm -rf "$out/_CPack_Packages"
ls "$out"/*.deb
