#!/usr/bin/env bash
# Builds everything and runs every test: once in a plain build, once under
# AddressSanitizer and UndefinedBehaviorSanitizer. Installs what is missing
# first. Hermetic tests need root (they make private mount namespaces).
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
jobs=${JOBS:-$(nproc)}

"$root/scripts/install-deps.sh"

run_suite() {
  local build=$1
  shift
  cmake -S "$root" -B "$build" "$@" >/dev/null
  cmake --build "$build" -j "$jobs"
  ctest --test-dir "$build" -j "$jobs" --output-on-failure
}

echo "== plain build"
run_suite "$root/build" -DCMAKE_BUILD_TYPE=RelWithDebInfo

echo "== sanitizer build (address, undefined)"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 \
UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite "$root/build-asan" -DCMAKE_BUILD_TYPE=Debug \
    -DZARK_SANITIZE=address,undefined
