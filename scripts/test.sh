#!/usr/bin/env bash
# Builds everything and runs every test: once in a plain build, once under
# AddressSanitizer and UndefinedBehaviorSanitizer; then the browser front
# end's build and unit tests, the Debian package's contents, and the
# end-to-end browser test against the installed host in the test network
# with a real router. Installs what is missing first. Needs root (private
# mount and network namespaces).
#
# ZARK_E2E=0 leaves the end-to-end test out; its steps are chosen as
# tests/e2e/run-e2e.sh describes.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
jobs=${JOBS:-$(nproc)}

"$root/scripts/install-deps.sh" --e2e

run_suite() {
  local build=$1
  shift
  cmake -S "$root" -B "$build" "$@" >/dev/null
  cmake --build "$build" -j "$jobs"
  ctest --test-dir "$build" -j "$jobs" --output-on-failure
}

# A build folder configured before with another install prefix keeps the
# host's default folders of that prefix in its cache: the options that make
# CMake compute them again from /usr.
forget_other_prefix() {
  local cached
  cached=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "$1/CMakeCache.txt" 2>/dev/null || true)
  if [ -n "$cached" ] && [ "$cached" != /usr ]; then
    printf '%s\n' '-UZARK_WEBAPID_*' -UZARK_SYSTEMD_UNITDIR
  fi
}

echo "== plain build"
# Prefix /usr as the main job and the package: the end-to-end test installs
# this build.
mapfile -t reset < <(forget_other_prefix "$root/build")
run_suite "$root/build" -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_INSTALL_PREFIX=/usr "${reset[@]}"

echo "== sanitizer build (address, undefined)"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 \
UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite "$root/build-asan" -DCMAKE_BUILD_TYPE=Debug \
    -DZARK_SANITIZE=address,undefined

echo "== browser front end: build and unit tests"
bash "$root/www/scripts/check.sh"

echo "== Debian package of the plain build"
bash "$root/packaging/check-deb.sh" "$root/build"

if [ "${ZARK_E2E:-1}" != 0 ]; then
  echo "== end-to-end browser test (test network, real router)"
  bash "$root/tests/e2e/run-e2e.sh" "$root/build"
fi
