#!/usr/bin/env bash
# Third-party ONVIF clients (npm packages onvif and node-onvif, pinned) check
# the camera simulator: connect, list presets, move, fetch the snapshot,
# receive a motion event through the client's own PullPoint subscription, and
# refuse a wrong password. The packages go to a temporary directory that is
# removed afterwards, like the simulator this script starts.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
build=${BUILD_DIR:-build}
case "$build" in /*) ;; *) build="$root/$build" ;; esac
camsim="$build/tools/camsim/camsim"
[ -x "$camsim" ] || { echo "onvif_clients: $camsim not built" >&2; exit 1; }

if ! command -v node >/dev/null || ! command -v npm >/dev/null; then
  sudo=""
  [ "$(id -u)" -eq 0 ] || sudo=sudo
  $sudo apt-get update -q
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -q --no-install-recommends nodejs npm
fi

work=$(mktemp -d /tmp/ptz-onvif-clients.XXXXXX)
sim_pid=""
cleanup() {
  [ -n "$sim_pid" ] && kill "$sim_pid" 2>/dev/null && wait "$sim_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

cp "$root/scripts/checks.d/onvif_clients.js" "$work/"
(cd "$work" && timeout 300 npm install --no-save --no-audit --no-fund --loglevel=error \
   onvif@0.8.3 node-onvif@0.1.7 >/dev/null)

CAMSIM_QUIET=1 "$camsim" > "$work/camsim.out" 2> "$work/camsim.err" &
sim_pid=$!
for _ in $(seq 100); do
  grep -q CAMSIM_PORT= "$work/camsim.out" 2>/dev/null && break
  sleep 0.05
done
port=$(sed -n 's/^CAMSIM_PORT=//p' "$work/camsim.out")
[ -n "$port" ] || { echo "onvif_clients: simulator did not start" >&2; cat "$work/camsim.err" >&2; exit 1; }

(cd "$work" && timeout 120 node onvif_clients.js "$port")

# The moves the simulator saw: 5 from one client, 9 from the other, nothing
# from the wrong passwords.
moves=$(curl -sf --max-time 5 "http://127.0.0.1:$port/control/moves" | cut -f1 | tr '\n' ' ')
if [ "$moves" != "5 9 " ]; then
  echo "onvif_clients: moves seen by the simulator: '$moves', expected '5 9 '" >&2
  exit 1
fi
echo "onvif_clients: ok"
