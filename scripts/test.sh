#!/usr/bin/env bash
# Installs what is missing, builds, and runs every test: unit tests, then the
# integration tests against a throwaway PostgreSQL cluster, the camera
# simulator and local HTTP servers (all started and stopped by the tests),
# then the extra checks in scripts/checks.d.
#
#   scripts/test.sh                         normal build in ./build
#   BUILD_DIR=build-asan SANITIZE=address scripts/test.sh    ASan + UBSan
#   BUILD_DIR=build-tsan SANITIZE=thread LABELS=tsan scripts/test.sh
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
cd "$root"
build=${BUILD_DIR:-build}
sanitize=${SANITIZE:-}
labels=${LABELS:-}
jobs=${JOBS:-$(nproc)}

scripts/deps.sh
cmake -S . -B "$build" -DPTZ_SANITIZE="$sanitize" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j"$jobs"

args=(--output-on-failure -j"$jobs" --timeout 600)
[ -n "$labels" ] && args+=(-L "$labels")
(cd "$build" && ctest "${args[@]}")

if [ -z "$labels" ] && [ -z "$sanitize" ]; then
  for check in scripts/checks.d/*.sh; do
    [ -e "$check" ] || continue
    echo "== check: $check"
    BUILD_DIR="$build" bash "$check"
  done
fi
