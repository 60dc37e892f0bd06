#!/usr/bin/env bash
# Builds the benchmarks and runs them against a throwaway PostgreSQL cluster
# (and whatever servers each benchmark starts itself).
#   scripts/bench.sh                 every benchmark in bench/
#   scripts/bench.sh patrol_bench    one of them (extra arguments go to it)
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
cd "$root"
build=${BUILD_DIR:-build-bench}
scripts/deps.sh
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release -DPTZ_SANITIZE= >/dev/null
cmake --build "$build" -j"${JOBS:-$(nproc)}"

pgdir=$(mktemp -d /tmp/ptzbench.XXXXXX)
trap 'scripts/pg_cluster.sh stop "$pgdir" >/dev/null' EXIT
scripts/pg_cluster.sh start "$pgdir"
export PGHOST=$pgdir PGUSER=ptz PGDATABASE=ptztest PTZ_SOURCE_DIR=$root PTZ_BINARY_DIR=$root/$build PTZ_PG_DIR=$pgdir

if [ $# -gt 0 ]; then
  name=$1; shift
  bin=$(find "$build/bench" -type f -executable -name "$name" | head -n 1)
  "$bin" "$@"
else
  find "$build/bench" -type f -executable -name '*_bench' | sort | while read -r bin; do
    echo "== $bin"
    "$bin"
  done
fi
