#!/usr/bin/env bash
# Kept for old habits: scripts/bench does the work.
#   scripts/bench.sh                 every benchmark
#   scripts/bench.sh NAME [ARGS...]  one benchmark, with arguments for it
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
if [ $# -gt 0 ]; then
  name=$1; shift
  exec "$here/bench" "$name" -- "$@"
fi
exec "$here/bench"
