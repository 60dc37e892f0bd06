#!/usr/bin/env bash
# Cross-builds the library for the target (32-bit big-endian PowerPC Linux) and
# runs its unit tests against the fake host under qemu-ppc, in both time_t
# widths: the default 64 bits (PTZ_TIME64=ON) and the C library's 32 bits.
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
cd "$root"
jobs=${JOBS:-$(nproc)}

# host_compile <build dir> <flags>...: a host file that includes the headers
# carrying time types, compiled for the target with the flags.
host_compile() {
  local build=$1
  shift
  printf '#include "executor/guardExecutor.h"\n#include "host/timer.h"\n' |
    powerpc-linux-gnu-g++ -std=c++17 -fsyntax-only "$@" -I. -I"$build/generated" -x c++ -
}

# cross <build dir> <PTZ_TIME64> <width of time_t in bits>
cross() {
  local build=$1 time64=$2 bits=$3
  echo "== cross build, PTZ_TIME64=$time64: $bits-bit time_t ($build)"
  cmake -S . -B "$build" -DCMAKE_TOOLCHAIN_FILE=cmake/powerpc-linux-gnu.cmake -DPTZ_LIBRARY_ONLY=ON \
    -DPTZ_TIME64="$time64" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
  cmake --build "$build" -j"$jobs"
  file -L "$build/libptzpatrol.so" | grep -q 'ELF 32-bit MSB.*PowerPC' || { echo "not a 32-bit big-endian PowerPC library" >&2; exit 1; }
  grep -q "define PTZ_TIME_T_BITS $bits\$" "$build/generated/common/ptzpatrol_config.h" ||
    { echo "ptzpatrol_config.h does not record a $bits-bit time_t" >&2; exit 1; }
  if [ "$bits" = 64 ]; then
    # Everything built here (GoogleTest included) calls the C library's 64-bit
    # time functions, never their 32-bit twins.
    if powerpc-linux-gnu-nm -u "$build/libptzpatrol.so" "$build"/tests/*/*_tests |
      grep -E ' U (localtime_r|gmtime_r|mktime|time|gettimeofday|clock_gettime|clock_nanosleep|nanosleep|stat|lstat|fstat|fcntl|pthread_cond_timedwait|pthread_mutex_timedlock|utimensat|futimens)@'; then
      echo "32-bit time functions referenced in a 64-bit time_t build" >&2
      exit 1
    fi
  fi
  # A host compiled with the same width builds against the headers; one
  # compiled with the other width stops at them, with the reason.
  local time64flags=(-D_TIME_BITS=64 -D_FILE_OFFSET_BITS=64) same=() other=()
  if [ "$bits" = 64 ]; then same=("${time64flags[@]}"); else other=("${time64flags[@]}"); fi
  host_compile "$build" "${same[@]}"
  if host_compile "$build" "${other[@]}" 2>"$build/host-mismatch.log" ||
    ! grep -q "ptzpatrol was built with a $bits-bit time_t" "$build/host-mismatch.log"; then
    echo "a host with the other time_t width is not stopped by the headers" >&2
    exit 1
  fi
  (cd "$build" && PTZ_EXPECT_TIME_T_BITS=$bits ctest -L unit --output-on-failure -j"$jobs" --timeout 600)
}

cross "${BUILD_DIR:-build}-ppc" ON 64
cross "${BUILD_DIR:-build}-ppc-time32" OFF 32
