#!/usr/bin/env bash
# Runs the hardening checks and writes what they showed into README.md's
# "Hardening figures" section (between its begin and end marks): fuzzing
# executions and crashes per target, the corpus regressions, the fault
# tests, the load test and the status-poll latency, the sanitizer runs and
# static analysis. The section says what was run, on which commit and
# machine. A check that fails is written down as failed, and the script
# then exits with 1.
#
# Environment:
#   FIGURES_FUZZ_SECONDS   seconds of fuzzing per target (default 60)
#   JOBS                   build and test jobs (default: processors)
# Needs root, like the test command.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
jobs=${JOBS:-$(nproc)}
# shellcheck source=scripts/builds.sh
. "$root/scripts/builds.sh"
fuzz_seconds=${FIGURES_FUZZ_SECONDS:-60}
readme=$root/README.md
begin_mark='<!-- hardening figures: begin -->'
end_mark='<!-- hardening figures: end -->'

install_deps_once --hardening

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
failed=()

# Runs a check, its output in $work/NAME.log; notes a failure.
check() {
  local name=$1
  shift
  echo "== $name ($(date +%T))"
  if "$@" >"$work/$name.log" 2>&1; then
    echo "   passed"
  else
    echo "   FAILED (last lines follow)"
    tail -n 30 "$work/$name.log"
    failed+=("$name")
  fi
}

# "N tests, M failed" of one or more CTest logs together.
ctest_outcome() {
  local log line total=0 failed_count=0
  for log in "$@"; do
    line=$(grep -Eo '[0-9]+% tests passed, [0-9]+ tests failed out of [0-9]+' \
      "$log" | tail -1)
    if [ -z "$line" ]; then
      echo "did not run"
      return
    fi
    failed_count=$((failed_count + $(sed -E 's/.*passed, ([0-9]+) tests failed.*/\1/' <<<"$line")))
    total=$((total + $(sed -E 's/.*out of ([0-9]+)/\1/' <<<"$line")))
  done
  echo "$total tests, $failed_count failed"
}

# The names of the tests a CTest log ran, each with its outcome.
ctest_cases() {
  sed -nE 's/^ *[0-9]+\/[0-9]+ Test +#[0-9]+: ([^ ]+) \.+ *([A-Za-z*]+( [A-Za-z]+)?) .*/\1 \2/p' "$1" |
    sort
}

# The plain suite runs in four parts, each test once: the fault tests, the
# load test (verbose: its figures are in its output) and the security walk
# have rows of their own; "suite-plain" is the rest. The whole suite's row
# adds the four up.
check build-plain build_plain
check suite-plain ctest --test-dir "$root/build" -j "$jobs" \
  -LE '^(faults|load|security)$' --output-on-failure
check faults ctest --test-dir "$root/build" -L '^faults$' --output-on-failure
check load ctest --test-dir "$root/build" -L '^load$' -V
check security ctest --test-dir "$root/build" -L '^security$' \
  --output-on-failure
check build-asan build_asan
check suite-asan ctest --test-dir "$root/build-asan" -j "$jobs" \
  --output-on-failure
check status-polls "$root/build/bin/status_poll_bench"
check tsan bash "$root/scripts/tsan.sh"
check fuzz env FUZZ_SECONDS="$fuzz_seconds" FUZZ_SUMMARY="$work/fuzz.summary" \
  bash "$root/scripts/fuzz.sh"
check analysis env ANALYZE_SUMMARY="$work/analysis.summary" \
  bash "$root/scripts/analyze.sh"

# The first line of log NAME matching PATTERN (CTest's "NN: " prefix of
# verbose output taken off first), or "missing".
line_of() {
  local line
  line=$(sed 's/^[0-9]*: //' "$work/$1.log" 2>/dev/null | grep -m1 "$2" || true)
  echo "${line:-missing}"
}

# "passed", or "**failed**" when any of the checks named failed.
outcome() {
  local name wanted
  for name in "${failed[@]}"; do
    for wanted in "$@"; do
      if [ "$name" = "$wanted" ]; then
        echo "**failed**"
        return
      fi
    done
  done
  echo "passed"
}

section=$work/section.md
{
  echo "$begin_mark"
  echo
  echo "Produced by \`bash scripts/figures.sh\` on $(date -u +%Y-%m-%d), commit" \
    "$(git -C "$root" rev-parse --short HEAD)$(git -C "$root" diff --quiet HEAD -- . ':!README.md' || echo ' with local changes'), on" \
    "$(nproc) processors, $(uname -r)."
  echo
  echo "| check | what ran | outcome |"
  echo "|---|---|---|"
  echo "| whole suite, plain build | $(ctest_outcome "$work"/{suite-plain,faults,load,security}.log) | $(outcome suite-plain faults load security) |"
  echo "| whole suite, AddressSanitizer + LeakSanitizer + UndefinedBehaviorSanitizer | $(ctest_outcome "$work/suite-asan.log") | $(outcome suite-asan) |"
  echo "| host framework and host, ThreadSanitizer | $(line_of tsan '^tsan: ' | sed 's/^tsan: //') | $(outcome tsan) |"
  echo "| corpus regressions (every saved input of every target) | $(grep -cE 'Test +#[0-9]+: [A-Za-z_.]*Corpus[A-Za-z_.]* .*Passed' "$work/suite-plain.log" || true) corpus tests passed in the plain suite | $(outcome suite-plain) |"
  echo "| fault tests | $(ctest_outcome "$work/faults.log") | $(outcome faults) |"
  echo "| security walk | $(ctest_outcome "$work/security.log") | $(outcome security) |"
  echo "| load | $(line_of load '^load: ' | sed 's/^load: //') | $(outcome load) |"
  echo "| status polls (benchmark) | $(line_of status-polls '^status polls: ' | sed 's/^status polls: //') | measured |"
  echo "| static analysis | $(grep -h 'clang-tidy:\|cppcheck:' "$work/analysis.summary" 2>/dev/null | head -2 | sed 's/^ *//' | paste -sd';' | sed 's/;/; /') | $(outcome analysis) |"
  echo
  echo "Fuzzing, $fuzz_seconds s per target, two targets at a time" \
    "(libFuzzer, AddressSanitizer + UndefinedBehaviorSanitizer):"
  echo
  if [ -s "$work/fuzz.summary" ]; then
    echo '```'
    cat "$work/fuzz.summary"
    echo '```'
  else
    echo "(the fuzzing run did not finish: **failed**)"
  fi
  echo
  echo "Fault tests:"
  echo
  ctest_cases "$work/faults.log" | sed 's/^/- /'
  echo
  echo "$end_mark"
} >"$section"

if ! grep -qF "$begin_mark" "$readme"; then
  echo "figures: $readme has no \"$begin_mark\" line" >&2
  exit 1
fi
awk -v begin="$begin_mark" -v end="$end_mark" -v file="$section" '
  $0 == begin { while ((getline line < file) > 0) print line; skip = 1; next }
  $0 == end { skip = 0; next }
  !skip { print }
' "$readme" >"$work/README.md"
cp "$work/README.md" "$readme"
echo "== README.md's hardening figures:"
cat "$section"

if [ ${#failed[@]} -gt 0 ]; then
  echo "!!! failed: ${failed[*]}"
  exit 1
fi
