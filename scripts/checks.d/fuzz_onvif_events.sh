#!/usr/bin/env bash
# Fuzzes the ONVIF event reply reader and the event trackers with libFuzzer
# (clang, ASan + UBSan) for a bounded time: FUZZ_SECONDS (default 60). The
# seed corpus (tests/fuzz/corpus_onvif_events: pull, subscription, renew and
# fault replies as cameras write them) is copied to a scratch directory; a
# crash leaves its input in $BUILD_DIR/fuzz and fails.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
cd "$root"
build=${BUILD_DIR:-build}
seconds=${FUZZ_SECONDS:-60}

if ! command -v clang++ >/dev/null; then
  sudo=""
  [ "$(id -u)" -eq 0 ] || sudo=sudo
  $sudo apt-get update -q
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -q --no-install-recommends clang
fi

out="$build/fuzz"
mkdir -p "$out"
clang++ -std=c++17 -g -O1 -fsanitize=fuzzer,address,undefined -fno-sanitize-recover=all \
  -I"$root" tests/fuzz/onvif_events_fuzz.cpp hostlib/camera/onvif_soap.cpp \
  hostlib/camera/onvif_event_soap.cpp hostlib/camera/onvif_event_tracker.cpp \
  -lpugixml -lcrypto -o "$out/onvif_events_fuzz"

corpus=$(mktemp -d)
trap 'rm -rf "$corpus"' EXIT
cp tests/fuzz/corpus_onvif_events/* "$corpus"/
echo "fuzz: ONVIF event replies for ${seconds}s"
timeout -k 10 $((seconds + 60)) "$out/onvif_events_fuzz" \
  -max_total_time="$seconds" -max_len=8192 -rss_limit_mb=2048 -timeout=10 \
  -dict=tests/fuzz/onvif_events.dict \
  -artifact_prefix="$out/onvif_events_" -print_final_stats=1 "$corpus" 2>"$out/onvif_events.log" \
  || { tail -n 40 "$out/onvif_events.log"; echo "fuzz: FAILED (input in $out)"; exit 1; }
grep -E "stat::number_of_executed_units|Done" "$out/onvif_events.log" | tail -n 2
echo "fuzz: passed"
