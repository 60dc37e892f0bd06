#!/usr/bin/env bash
# The README's first command runs through: its exit status, and the files it
# wrote (the HTML page, and the snapshots it names: valid JPEGs, as many as
# the tour takes). The narration's wording is not checked.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
build=${BUILD_DIR:-build}
case "$build" in /*) ;; *) build="$root/$build" ;; esac
out=$(mktemp -d /tmp/ptzdemo-check.XXXXXX)
trap 'rm -rf "$out"' EXIT
# Its own database: a throwaway cluster even when the caller has PG* set.
unset PGHOST PGHOSTADDR PGPORT PGDATABASE PGUSER PGPASSWORD PGSERVICE
BUILD_DIR="$build" DEMO_DIR="$out" timeout -k 10 600 "$root/scripts/demo" >"$out/demo.log" 2>&1 ||
  { tail -n 40 "$out/demo.log"; echo "demo: FAILED" >&2; exit 1; }

fail() { echo "demo: $*" >&2; tail -n 40 "$out/demo.log"; exit 1; }
[ -s "$out/index.html" ] || fail "no index.html"
jpeg() { [ "$(head -c 2 "$1" | od -An -tx1 | tr -d ' ')" = ffd8 ] && [ "$(tail -c 2 "$1" | od -An -tx1 | tr -d ' ')" = ffd9 ]; }
count() { find "$out/$1" -name '*.jpg' | wc -l; }
# A direct run of two presets (3 moves), one of three over MJPEG (4 moves), and
# the guard: at least its first move, the direct run (2) and the guard run again (3).
[ "$(count http)" -eq 3 ] || fail "$(count http) HTTP snapshots, expected 3"
[ "$(count mjpeg)" -eq 4 ] || fail "$(count mjpeg) MJPEG snapshots, expected 4"
[ "$(count guard)" -ge 6 ] || fail "$(count guard) guard snapshots, expected 6 or more"
images=$(grep -o '<img src="[^"]*"' "$out/index.html" | sed 's/<img src="//; s/"$//')
[ "$(echo "$images" | wc -l)" -eq "$(find "$out" -name '*.jpg' | wc -l)" ] || fail "the page does not show every snapshot"
for f in $images; do
  [ -f "$out/$f" ] || fail "the page names $f, which is missing"
  jpeg "$out/$f" || fail "$f is not a JPEG"
done
# The service scene: the guard's run seen while the entry was in force, then
# the entry ended and the run with it; the service's log kept.
jq -e '.cameras[0] | .guard == "running" and .run.running and .run.type == "guard" and .entry.mode == "first"' \
  "$out/service/status-running.json" >/dev/null || fail "status-running.json shows no guard run"
jq -e '.cameras[0] | .entry == null and (.run.running | not) and .guard != "running" and .run.moves > 0' \
  "$out/service/status-ended.json" >/dev/null || fail "status-ended.json shows a run or an entry"
[ -s "$out/service/ptzpatrold.log" ] || fail "no ptzpatrold.log"
echo "demo: ok ($(echo "$images" | wc -l) snapshots)"
