#!/usr/bin/env bash
# The rule-apply benchmark of the port-map library against a real router:
# builds bench/apply_rules_bench.cpp (RelWithDebInfo) and runs it in a test
# network of its own (testnet/testnet.sh: outside host, router running
# miniupnpd, server), in the server namespace, where the benchmark enters
# its private mount namespace. The network is brought down again on every
# exit path: the benchmark ending or failing, Ctrl-C, SIGTERM, SIGHUP.
#
#   scripts/bench-apply.sh [--benchmark_filter=...] [other --benchmark_ flags]
#
# Needs root (network and mount namespaces, nftables) and the packages of
# scripts/install-deps.sh (miniupnpd-nftables, miniupnpc, nftables,
# libbenchmark-dev). The figures end with a summary table in Markdown.
#
# ZARK_BENCH_BUILD_DIR: build folder (default: build-bench in the source
# tree). ZARK_BENCH_TIME_LIMIT: seconds the benchmark may run before it is
# stopped (default 2400).
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
build=${ZARK_BENCH_BUILD_DIR:-$root/build-bench}
limit=${ZARK_BENCH_TIME_LIMIT:-2400}
jobs=${JOBS:-2}

if [ "$(id -u)" != 0 ]; then
  echo "bench-apply: run as root (network and mount namespaces)" >&2
  exit 2
fi
for tool in /usr/sbin/miniupnpd /usr/bin/upnpc /usr/sbin/nft /usr/bin/nsenter \
  /usr/bin/timeout; do
  if [ ! -x "$tool" ]; then
    echo "bench-apply: $tool is missing; run scripts/install-deps.sh" >&2
    exit 2
  fi
done

cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j "$jobs" --target zark_bench_apply

# testnet.sh runs the program and brings the network down after it. It runs
# in the background so that this script can act on a signal at once: a
# signal is passed on to the runner's child (timeout, which passes it on to
# the benchmark), after which testnet.sh tears the network down and ends.
runner=
stop() {
  trap - INT TERM HUP
  if [ -n "$runner" ]; then
    for child in $(pgrep -P "$runner" || true); do
      kill -TERM "$child" 2>/dev/null || true
    done
    wait "$runner" 2>/dev/null || true
  fi
  exit 130
}
trap stop INT TERM HUP

bash "$root/testnet/testnet.sh" run \
  /usr/bin/timeout --foreground --kill-after=10 "$limit" \
  "$build/bin/zark_bench_apply" "$@" &
runner=$!
set +e
wait "$runner"
status=$?
set -e
runner=
exit "$status"
