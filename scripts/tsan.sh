#!/usr/bin/env bash
# ThreadSanitizer build of the host framework (platform/webapi: requests,
# responses, background tasks), of the host (host/) and of the status module
# with its keeper thread (status/), and their test suites (test names
# starting with "WebAPI", "Host", "Status" or "Keeper"; not the test-network
# cases), in a build folder of their own. Fails on any data race, lock-order inversion or failed test.
#
# Environment:
#   TSAN_BUILD   build folder (default <repo>/build-tsan)
#   JOBS         build and test jobs (default: number of processors)
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
build=${TSAN_BUILD:-$root/build-tsan}
jobs=${JOBS:-$(nproc)}

"$root/scripts/install-deps.sh"

echo "== thread sanitizer build in $build"
cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=Debug \
  -DZARK_SANITIZE=thread -DZARK_BUILD_BENCH=OFF >/dev/null
cmake --build "$build" -j "$jobs" \
  --target webapi_tests host_unit_test host_test status_module_test

echo "== host framework and host tests under ThreadSanitizer"
started=$(date +%s)
status=0
TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1" \
  ctest --test-dir "$build" -R '^(WebAPI|Host|Status|Keeper)' \
    -E '^StatusTestnet' -j "$jobs" \
    --output-on-failure >"$build/tsan-ctest.log" 2>&1 || status=$?
tail -n 40 "$build/tsan-ctest.log"
if grep -q "No tests were found" "$build/tsan-ctest.log"; then
  echo "!!! no WebAPI, Host, Status or Keeper test was found"
  status=1
fi
if grep -q "WARNING: ThreadSanitizer" "$build/tsan-ctest.log"; then
  echo "!!! ThreadSanitizer reported a problem (see above)"
  status=1
fi
echo "tsan: $(grep -Eo '[0-9]+ tests failed out of [0-9]+' \
  "$build/tsan-ctest.log" || echo 'no test ran'), $(($(date +%s) - started)) s"
exit "$status"
