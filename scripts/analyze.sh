#!/usr/bin/env bash
# Static analysis: clang-tidy (checks in .clang-tidy) and cppcheck
# (suppressions in .cppcheck-suppressions; single false positives are
# suppressed inline with their reason) over the compile database of a clang
# build configured in its own folder. Fails when either finds anything in
# the folders that must be clean; prints a summary either way.
#
# Environment:
#   TIDY_BUILD        build folder (default <repo>/build-tidy); only
#                     configured, never built
#   ANALYZE_SUMMARY   also write the summary to this file
#   JOBS              parallel analyses (default: number of processors)
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
build=${TIDY_BUILD:-$root/build-tidy}
jobs=${JOBS:-$(nproc)}

# clang with its sanitizer and libFuzzer runtimes, clang-tidy, cppcheck.
"$root/scripts/install-deps.sh" --hardening

# Folders whose findings fail the run: every program and library source
# (the tests are left out).
checked=(platform host src probe tools fuzz)
echo "== configuring $build (clang, compile database only)"
CC=clang CXX=clang++ cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=Debug \
  -DZARK_BUILD_FUZZERS=OFF -DZARK_BUILD_BENCH=OFF >/dev/null
database=$build/compile_commands.json

# A regular expression matching the paths under the given folders or files.
paths_regex() {
  local items=() item
  for item in "$@"; do
    items+=("$(printf '%s' "$root/$item" | sed 's/[.[\*^$()+?{|]/\\&/g')")
  done
  local IFS='|'
  printf '^(%s)(/|$)' "${items[*]}"
}

# Runs clang-tidy over the sources under the given folders; leaves its
# findings in $1, one "file:line:col: severity: text [check]" a line.
tidy() {
  local findings=$1
  shift
  local pattern
  pattern=$(paths_regex "$@")
  run-clang-tidy -p "$build" -j "$jobs" -quiet -header-filter="$pattern" \
    "$pattern" >"$findings.log" 2>&1 || true
  sed 's/\x1b\[[0-9;]*m//g' "$findings.log" |
    grep -E '^/.*:[0-9]+:[0-9]+: (warning|error): ' |
    sed "s|^$root/||" | sort -u >"$findings" || true
}

# Runs cppcheck over the same; findings in $1.
cppcheck_run() {
  local findings=$1
  shift
  local filters=() item
  for item in "$@"; do
    if [ -d "$root/$item" ]; then
      filters+=("--file-filter=$root/$item/*")
    else
      filters+=("--file-filter=$root/$item")
    fi
  done
  cppcheck --project="$database" --std=c++20 -j "$jobs" \
    --enable=warning,style,performance,portability --inline-suppr \
    --suppressions-list="$root/.cppcheck-suppressions" \
    --template='{file}:{line}: {severity}: {message} [{id}]' \
    "${filters[@]}" 2>&1 |
    grep -E '^/.*:[0-9]+: ' | sed "s|^$root/||" | sort -u >"$findings" || true
}

# Sources of the compile database under the given folders.
sources() {
  grep -oE '"file": "[^"]*"' "$database" | sed 's/"file": "//; s/"$//' |
    grep -cE "$(paths_regex "$@")" || true
}

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
started=$(date +%s)

echo "== clang-tidy ($(clang-tidy --version | sed -n 's/.*version //p' |
  head -1))"
tidy "$work/tidy-checked" "${checked[@]}"
tidy_seconds=$(($(date +%s) - started))

echo "== cppcheck ($(cppcheck --version))"
started=$(date +%s)
cppcheck_run "$work/cppcheck-checked" "${checked[@]}"
cppcheck_seconds=$(($(date +%s) - started))

count() { wc -l <"$1" | tr -d ' '; }
files=$(sources "${checked[@]}")

for kind in tidy cppcheck; do
  if [ -s "$work/$kind-checked" ]; then
    echo "--- $kind findings (these fail the run):"
    cat "$work/$kind-checked"
  fi
done

tidy_found=$(count "$work/tidy-checked")
cppcheck_found=$(count "$work/cppcheck-checked")
summary=$work/summary
{
  echo "analysis: $files sources in ${checked[*]}"
  echo "  clang-tidy: $tidy_found finding(s) (${tidy_seconds} s)"
  echo "  cppcheck:   $cppcheck_found finding(s) (${cppcheck_seconds} s)"
} >"$summary"
echo "== analysis summary"
cat "$summary"
if [ -n "${ANALYZE_SUMMARY:-}" ]; then
  cp "$summary" "$ANALYZE_SUMMARY"
fi
if [ "$tidy_found" -ne 0 ] || [ "$cppcheck_found" -ne 0 ]; then
  echo "!!! static analysis found problems (listed above)"
  exit 1
fi
echo "static analysis clean"
