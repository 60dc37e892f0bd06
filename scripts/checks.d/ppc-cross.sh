#!/usr/bin/env bash
# Cross-builds the library for the target (32-bit big-endian PowerPC Linux) and
# runs its unit tests against the fake host under qemu-ppc.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
cd "$root"
build="${BUILD_DIR:-build}-ppc"
cmake -S . -B "$build" -DCMAKE_TOOLCHAIN_FILE=cmake/powerpc-linux-gnu.cmake -DPTZ_LIBRARY_ONLY=ON \
  -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j"${JOBS:-$(nproc)}"
file "$build/libptzpatrol.so" | grep -q 'ELF 32-bit MSB.*PowerPC' || { echo "not a 32-bit big-endian PowerPC library" >&2; exit 1; }
(cd "$build" && ctest -L unit --output-on-failure -j"${JOBS:-$(nproc)}" --timeout 600)
