#!/usr/bin/env bash
# End-to-end browser test: the installed host with the module and the front
# end, in the test network with a real router (miniupnpd), driven by
# Chromium through www/e2e/run.mjs.
#
#   tests/e2e/run-e2e.sh [BUILD]      (BUILD: default ./build)
#
# 1. installs BUILD and www/dist into a fresh state folder (packaging/
#    sandbox.sh stage) with an account "admin" with a random password;
# 2. brings up the test network (testnet/testnet.sh), starts the probe
#    service on the outside host when it is built, and names it in the
#    library configuration;
# 3. runs the host in the server namespace, in a private mount namespace,
#    and relays a free port of the machine's 127.0.0.1 to it;
# 4. runs www/e2e/run.mjs against it: log in, every screen, and the steps
#    below; then checks the router's mappings with upnpc -l from the server;
# 5. tears it all down on every exit path.
#
# Steps, each "1" (run, the default) or "0" (skip):
#   ZARK_E2E_DETECT        router detection, which must find the router
#                          (KLibDetectRouter)
#   ZARK_E2E_ROUTER_STEP   choose "Generic/UPnP IGD", save the configuration
#                          (unset: only after a detection, whose result
#                          RouterConf set reads)
#                          (ZARK_E2E_ROUTER_MODE=natpmp: choose "Generic/
#                          NAT-PMP" and talk to the router by NAT-PMP)
#   ZARK_E2E_RULES         add three rules, save, follow the progress bar,
#                          see them with upnpc -l (unset: only with the
#                          router step)
#   ZARK_E2E_SERVICES      open the ports of the service "ssh", see them
#                          with upnpc -l (unset: only with the router step)
#   ZARK_E2E_REACHABILITY  the reachability test of the rules sees
#                          "reachable" (KLibTestRules, ZARKIGetExternalIP,
#                          and the probe service)
#
# Screenshots, summary.json and the programs' output go to
# ZARK_E2E_ARTIFACTS (default www/e2e-artifacts). The browser's run is
# bounded by ZARK_E2E_TIME_LIMIT seconds (default 900), every other wait by
# its own few seconds. Needs root, chromium, Node.js and www/node_modules
# (bash www/scripts/check.sh).
set -euo pipefail

tn_root=$(cd "$(dirname "$0")/../.." && pwd)
tn_build=$(realpath "${1:-$tn_root/build}")
artifacts=${ZARK_E2E_ARTIFACTS:-$tn_root/www/e2e-artifacts}
time_limit=${ZARK_E2E_TIME_LIMIT:-900}

# shellcheck source-path=SCRIPTDIR
source "$tn_root/testnet/testnet-host.sh"

fail() {
  echo "run-e2e: $*" >&2
  exit 1
}

[ "$(id -u)" -eq 0 ] || fail "needs root (network and mount namespaces)"
[ -x /usr/bin/chromium ] || [ -n "${ZARK_E2E_CHROMIUM:-}" ] ||
  fail "chromium is missing: apt-get install -y chromium (or scripts/install-deps.sh --e2e)"
command -v node >/dev/null || fail "node is missing (scripts/install-deps.sh)"
[ -d "$tn_root/www/node_modules/playwright-core" ] ||
  fail "www/node_modules is missing: bash www/scripts/check.sh"
[ -f "$tn_root/www/dist/index.html" ] ||
  fail "www/dist is missing: bash www/scripts/check.sh"

# gate VARIABLE: the step's setting, "1" (also when unset) or "0".
gate() {
  local value=${!1:-1}
  [ "$value" = 0 ] || value=1
  echo "$value"
}

detect=$(gate ZARK_E2E_DETECT)
router_step=$(gate ZARK_E2E_ROUTER_STEP)
rules=$(gate ZARK_E2E_RULES)
services=$(gate ZARK_E2E_SERVICES)
reachability=$(gate ZARK_E2E_REACHABILITY)
if [ "$reachability" = 1 ] && ! [ -x "$tn_build/bin/zark-probed" ]; then
  fail "the reachability step needs the probe service: $tn_build/bin/zark-probed is not built (or set ZARK_E2E_REACHABILITY=0)"
fi
# RouterConf set reads the last detection's result, so storing a router
# needs a detection first; rules and services need a stored router.
if [ "$detect" = 0 ] && [ -z "${ZARK_E2E_ROUTER_STEP:-}" ]; then
  router_step=0
fi
if [ "$router_step" = 0 ]; then
  [ -z "${ZARK_E2E_RULES:-}" ] && rules=0
  [ -z "${ZARK_E2E_SERVICES:-}" ] && services=0
fi

work=$(mktemp -d "$tn_build/e2e.XXXXXX")
tn_state="$work/state"
tn_logs="$tn_state/logs"
mkdir -p "$tn_logs"

cleanup() {
  local status=$?
  trap - EXIT INT TERM
  tn_down
  mkdir -p "$artifacts"
  cp "$tn_logs"/*.log "$artifacts/" 2>/dev/null || true
  rm -rf "$work"
  exit "$status"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

echo "run-e2e: steps: detect=$detect router=$router_step rules=$rules services=$services reachability=$reachability"

bash "$tn_root/packaging/sandbox.sh" stage "$tn_build" "$tn_state"
password_file=$(bash "$tn_root/packaging/sandbox.sh" account "$tn_build" "$tn_state" admin)

tn_up "ze$$"
tn_start_dns
if tn_have_probe; then
  tn_start_probe
  tn_configure_probe
fi
tn_start_host

# A free port of the machine for the relay.
port=""
for ((candidate = 25000 + $$ % 1000; candidate < 27000; candidate++)); do
  if [ -z "$(ss -Hltn "sport = :$candidate")" ]; then
    port=$candidate
    break
  fi
done
[ -n "$port" ] || fail "no free port between 25000 and 27000"
tn_start_relay 127.0.0.1 "$port"

mkdir -p "$artifacts"
rm -f "$artifacts"/*.png "$artifacts"/*.log "$artifacts"/summary.json

e2e_env=(
  ZARK_E2E_URL="http://127.0.0.1:$port/"
  ZARK_E2E_ACCOUNT=admin
  ZARK_E2E_PASSWORD="$(cat "$password_file")"
  ZARK_E2E_ARTIFACTS="$artifacts"
  ZARK_E2E_MAPPINGS_CMD="ip netns exec $(tn_server_ns) timeout 20 upnpc -u $TN_ROOT_DESC -l"
)
if [ "$detect" = 1 ]; then
  e2e_env+=(ZARK_E2E_DETECT=1 ZARK_E2E_DETECT_REQUIRE=1)
fi
if [ "$router_step" = 1 ]; then
  case "${ZARK_E2E_ROUTER_MODE:-upnp}" in
  upnp) e2e_env+=("ZARK_E2E_ROUTER=Generic/UPnP IGD" ZARK_E2E_ROUTER_MODE=upnp) ;;
  natpmp) e2e_env+=("ZARK_E2E_ROUTER=Generic/NAT-PMP" ZARK_E2E_ROUTER_MODE=natpmp) ;;
  *) fail "ZARK_E2E_ROUTER_MODE is upnp or natpmp" ;;
  esac
fi
if [ "$rules" = 1 ]; then
  e2e_env+=(ZARK_E2E_RULES=1)
fi
if [ "$services" = 1 ]; then
  # ssh: one TCP section on port 22 (platform/firewall/data/services.d).
  e2e_env+=(ZARK_E2E_SERVICE=ssh "ZARK_E2E_SERVICE_MAPPINGS=TCP 22 22")
fi
if [ "$reachability" = 1 ]; then
  e2e_env+=(ZARK_E2E_REACHABILITY=1)
fi

status=0
(cd "$tn_root/www" && env "${e2e_env[@]}" timeout --kill-after=10 "$time_limit" node e2e/run.mjs) ||
  status=$?

# What the router holds in the end, for the artifacts.
tn_router_mappings >"$tn_logs/router-mappings.log" 2>&1 || true

if [ "$status" -ne 0 ]; then
  echo "run-e2e: FAILED (status $status); screenshots and logs in $artifacts" >&2
  exit "$status"
fi
echo "run-e2e: passed (detect=$detect router=$router_step rules=$rules services=$services reachability=$reachability); screenshots in $artifacts"
