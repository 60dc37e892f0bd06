#!/usr/bin/env bash
# Fuzzes the parsers that read what cameras and servers send, with libFuzzer
# (clang, ASan + UBSan, leaks detected), each for a bounded time: FUZZ_SECONDS
# per target (default 60). Targets: the multipart parser, the ONVIF reply
# reader, the ONVIF event reply reader and event trackers, the HTTP response
# head reader. Each starts from a copy of its seed
# corpus (tests/fuzz/corpus/<target>) with its dictionary (tests/fuzz/
# <target>.dict), guided by the values compared as well as by coverage (the
# XML library is not instrumented). A crash, a leak or an allocation above
# 128 MiB leaves its input in $BUILD_DIR/fuzz and fails the check; such inputs
# join the corpus, which the tests replay (fuzz_replay_*).
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
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT

# target  max_len  sources and libraries
targets=(
  "multipart_parser 4096 hostlib/http/multipart_parser.cpp"
  "onvif_reply 16384 hostlib/camera/onvif_soap.cpp -lpugixml -lcrypto"
  "response_head 4096 hostlib/http/response_head.cpp"
  "onvif_events 8192 hostlib/camera/onvif_soap.cpp hostlib/camera/onvif_event_soap.cpp hostlib/camera/onvif_event_tracker.cpp -lpugixml -lcrypto"
)
for t in "${targets[@]}"; do
  read -r name maxlen deps <<<"$t"
  # shellcheck disable=SC2086  # deps: several words
  clang++ -std=c++17 -g -O1 -fsanitize=fuzzer,address,undefined -fno-sanitize-recover=all \
    -I"$root" -I"$build/generated" "tests/fuzz/${name}_fuzz.cpp" $deps -o "$out/${name}_fuzz"
  mkdir -p "$scratch/$name"
  cp "tests/fuzz/corpus/$name"/* "$scratch/$name"/
  echo "fuzz: $name for ${seconds}s"
  timeout -k 10 $((seconds + 60)) "$out/${name}_fuzz" -dict="tests/fuzz/$name.dict" -use_value_profile=1 \
    -max_total_time="$seconds" -max_len="$maxlen" -rss_limit_mb=2048 -malloc_limit_mb=128 \
    -timeout=10 -artifact_prefix="$out/${name}-" -print_final_stats=1 "$scratch/$name" \
    2>"$out/$name.log" \
    || { tail -n 40 "$out/$name.log"; echo "fuzz: $name FAILED (input in $out)"; exit 1; }
  grep -E "stat::number_of_executed_units|Done" "$out/$name.log" | tail -n 2
done
echo "fuzz: passed"
