#!/usr/bin/env bash
# Bounded fuzzing run: builds every libFuzzer target with clang
# (-fsanitize=fuzzer,address,undefined; the libraries with coverage and
# the same sanitizers) in its own build folder, runs each target for
# FUZZ_SECONDS, and prints executions and crashes per target.
#
# Any crash, leak, timeout or out-of-memory input is copied to
# fuzz/crashes/<target>/ (where the target's corpus test runs it from then
# on) and the script fails. Needs root: several targets run in private
# mount and network namespaces.
#
# Environment:
#   FUZZ_SECONDS   seconds per target (default 15; 21 targets, two at a
#                  time: about 2.5 minutes of fuzzing)
#   FUZZ_JOBS      targets run at once (default 2)
#   FUZZ_TARGETS   space-separated subset of target names (default all)
#   FUZZ_BUILD     build folder (default <repo>/build-fuzz)
#   FUZZ_SUMMARY   also write the summary table to this file
#   JOBS           build jobs (default: number of processors)
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
build=${FUZZ_BUILD:-$root/build-fuzz}
seconds=${FUZZ_SECONDS:-15}
parallel=${FUZZ_JOBS:-2}
jobs=${JOBS:-$(nproc)}
# A single input slower than this counts as a hang.
unit_timeout=${FUZZ_UNIT_TIMEOUT:-25}

# clang with its sanitizer and libFuzzer runtimes, clang-tidy, cppcheck.
"$root/scripts/install-deps.sh" --hardening

# Targets: one per seed corpus fuzz/corpus/<name>/, built as Fuzz<name>.
names=()
for folder in "$root"/fuzz/corpus/*/; do
  names+=("$(basename "$folder")")
done
if [ -n "${FUZZ_TARGETS:-}" ]; then
  read -r -a names <<<"$FUZZ_TARGETS"
  for name in "${names[@]}"; do
    if ! [ -d "$root/fuzz/corpus/$name" ]; then
      echo "unknown fuzz target $name" >&2
      exit 2
    fi
  done
fi

echo "== fuzz build (clang, libFuzzer, address, undefined) in $build"
CC=clang CXX=clang++ cmake -S "$root" -B "$build" \
  -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  "-DCMAKE_C_FLAGS_RELWITHDEBINFO=-O1 -g" \
  "-DCMAKE_CXX_FLAGS_RELWITHDEBINFO=-O1 -g" \
  "-DCMAKE_C_FLAGS=-fsanitize=fuzzer-no-link" \
  "-DCMAKE_CXX_FLAGS=-fsanitize=fuzzer-no-link" \
  -DZARK_SANITIZE=address,undefined -DZARK_BUILD_BENCH=OFF >/dev/null
cmake --build "$build" -j "$jobs" --target "${names[@]/#/Fuzz}"

run_dir=$build/fuzz-run
mkdir -p "$run_dir"

# Runs one target; leaves "<executions> <corpus size> <crashes>" in
# $run_dir/<name>/result.
run_target() {
  local name=$1
  local dir=$run_dir/$name
  mkdir -p "$dir/corpus" "$dir/artifacts"
  rm -f "$dir"/artifacts/* "$dir/result"
  local status=0
  # New inputs go to the first folder (the build's); the seeds stay as
  # they are.
  ASAN_OPTIONS=detect_leaks=1:allocator_may_return_null=1 \
  UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    timeout --kill-after=30 $((seconds + 180)) \
    "$build/bin/Fuzz$name" -max_total_time="$seconds" \
      -timeout="$unit_timeout" -rss_limit_mb=2560 -print_final_stats=1 \
      -artifact_prefix="$dir/artifacts/" "$dir/corpus" \
      "$root/fuzz/corpus/$name" \
      >"$dir/log" 2>&1 || status=$?
  local executions corpus crashes
  executions=$(sed -n 's/^stat::number_of_executed_units: *//p' "$dir/log" |
                 tail -1)
  corpus=$(find "$dir/corpus" -type f | wc -l)
  crashes=$(find "$dir/artifacts" -type f | wc -l)
  if [ "$status" -ne 0 ] && [ "$crashes" -eq 0 ]; then
    # Died without leaving an input (the runner itself failed): a failure
    # all the same.
    crashes=1
    echo "$name exited with status $status and left no input" \
      >"$dir/artifacts/no-input-status-$status"
  fi
  echo "${executions:-0} $corpus $crashes" >"$dir/result"
}

echo "== fuzzing ${#names[@]} targets, ${seconds} s each, $parallel at a time"
started=$(date +%s)
for name in "${names[@]}"; do
  while [ "$(jobs -rp | wc -l)" -ge "$parallel" ]; do
    wait -n || true
  done
  run_target "$name" &
done
wait
elapsed=$(($(date +%s) - started))

summary=$(mktemp)
trap 'rm -f "$summary"' EXIT
failed=()
total_runs=0
{
  printf '%-22s %12s %10s %8s %8s\n' target executions exec/s corpus crashes
  for name in "${names[@]}"; do
    read -r executions corpus crashes <"$run_dir/$name/result"
    printf '%-22s %12s %10s %8s %8s\n' "$name" "$executions" \
      $((executions / seconds)) "$corpus" "$crashes"
    total_runs=$((total_runs + executions))
    if [ "$crashes" -gt 0 ]; then
      failed+=("$name")
    fi
  done
  printf '%-22s %12s %10s %8s %8s\n' all "$total_runs" "" "" \
    "${#failed[@]} target(s)"
  echo "fuzzing: ${#names[@]} targets, ${seconds} s each, $parallel at a" \
       "time, ${elapsed} s in all"
} >"$summary"
echo "== fuzzing summary"
cat "$summary"
if [ -n "${FUZZ_SUMMARY:-}" ]; then
  cp "$summary" "$FUZZ_SUMMARY"
fi

if [ ${#failed[@]} -gt 0 ]; then
  for name in "${failed[@]}"; do
    mkdir -p "$root/fuzz/crashes/$name"
    cp "$run_dir/$name"/artifacts/* "$root/fuzz/crashes/$name/"
    echo
    echo "!!! FUZZ FAILURE in $name: inputs copied to fuzz/crashes/$name/"
    ls -1 "$root/fuzz/crashes/$name/"
    echo "--- last lines of $run_dir/$name/log:"
    tail -40 "$run_dir/$name/log"
    echo "--- reproduce with: $build/bin/Fuzz$name <input>"
  done
  exit 1
fi
echo "no crash"
