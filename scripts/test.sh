#!/usr/bin/env bash
# Builds everything and runs every test: once in a plain build, once under
# AddressSanitizer, LeakSanitizer and UndefinedBehaviorSanitizer; the host
# framework and the host under ThreadSanitizer; a bounded libFuzzer run of
# every fuzz target; clang-tidy and cppcheck (beside all of these, at the
# lowest priority); then the browser front end's
# build and unit tests, the Debian package's contents, and the end-to-end
# browser test against the installed host in the test network with a real
# router. Installs what is missing first. Needs root (private mount and
# network namespaces).
#
# Environment:
#   ZARK_E2E=0            leaves the end-to-end test out (its steps are
#                         chosen as tests/e2e/run-e2e.sh describes)
#   ZARK_FUZZ_SECONDS     seconds of fuzzing per target (default 10)
#   ZARK_HARDENING=0      leaves out ThreadSanitizer, fuzzing and static
#                         analysis (quick local runs; CI runs them)
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
jobs=${JOBS:-$(nproc)}
# shellcheck source=scripts/builds.sh
. "$root/scripts/builds.sh"

hardening=${ZARK_HARDENING:-1}
deps=(--e2e)
if [ "$hardening" != 0 ]; then
  deps+=(--hardening)
fi
install_deps_once "${deps[@]}"

step() { echo "== $* ($(date +%T))"; }

# Static analysis needs no build of its own: it runs beside the builds and
# tests at the lowest priority, soaking up the processors while tests wait
# on the network, and its result is read at the end.
analysis_pid=
analysis_log=$root/build-tidy/analysis.log
stop_analysis() {
  if [ -n "$analysis_pid" ]; then
    kill -- "-$analysis_pid" 2>/dev/null || kill "$analysis_pid" 2>/dev/null ||
      true
  fi
}
trap stop_analysis EXIT
if [ "$hardening" != 0 ]; then
  mkdir -p "$root/build-tidy"
  step "static analysis started in the background (log: $analysis_log)"
  # A session of its own, so that it can be stopped as a whole; where the
  # kernel groups processes by session for scheduling, that group gets the
  # lowest weight too (otherwise it would share the processors equally).
  setsid bash -c 'echo 19 >/proc/self/autogroup 2>/dev/null || true
    exec nice -n 19 bash "$0"' "$root/scripts/analyze.sh" \
    >"$analysis_log" 2>&1 &
  analysis_pid=$!
fi

step "plain build"
# Prefix /usr as the main job and the package: the end-to-end test installs
# this build.
build_plain
ctest --test-dir "$root/build" -j "$jobs" --output-on-failure

step "sanitizer build (address, leak, undefined)"
build_asan
ctest --test-dir "$root/build-asan" -j "$jobs" --output-on-failure

if [ "$hardening" != 0 ]; then
  step "thread sanitizer: host framework and host"
  bash "$root/scripts/tsan.sh"

  step "bounded fuzzing run"
  FUZZ_SECONDS=${ZARK_FUZZ_SECONDS:-10} bash "$root/scripts/fuzz.sh"
fi

step "browser front end: build and unit tests"
bash "$root/www/scripts/check.sh"

step "Debian package of the plain build"
bash "$root/packaging/check-deb.sh" "$root/build"

if [ "${ZARK_E2E:-1}" != 0 ]; then
  step "end-to-end browser test (test network, real router)"
  bash "$root/tests/e2e/run-e2e.sh" "$root/build"
fi
if [ -n "$analysis_pid" ]; then
  step "static analysis: waiting for its result"
  analysis_status=0
  wait "$analysis_pid" || analysis_status=$?
  analysis_pid=
  cat "$analysis_log"
  if [ "$analysis_status" != 0 ]; then
    echo "!!! static analysis failed (status $analysis_status)"
    exit 1
  fi
fi
step "all tests passed"
