#!/usr/bin/env bash
# The demo: the main job inside the project's test network, so that the
# whole job can be tried on a machine without a router of its own. Run as
# root.
#
#   bash scripts/demo.sh [--listen ADDRESS:PORT]
#
#   outside host 1.2.3.2      the probe service zark-probed (when built)
#   router 1.2.3.1 / 192.168.77.1   miniupnpd: UPnP IGD and NAT-PMP
#   server 192.168.77.2       zark-webapid with the module
#
# The page is relayed to the machine's 127.0.0.1:5000 (--listen or
# ZARK_LISTEN to change). ZARK_STATE_DIR (default ./state-demo) and
# ZARK_BUILD_DIR (default ./build) and ZARK_KEEPER_INTERVAL (default 300 s)
# as for scripts/run.sh. Ctrl-C stops the host and removes the network.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
# shellcheck source=scripts/main-job.sh
. "$root/scripts/main-job.sh"
parse_main_job_args demo.sh "$root/state-demo" "$@"

if [ "$(id -u)" -ne 0 ]; then
  echo "demo.sh: run it as root: network and mount namespaces" >&2
  exit 1
fi
if [[ "$address" == *:* ]]; then
  echo "demo.sh: --listen takes IPv4-ADDRESS:PORT, for example 127.0.0.1:5000" >&2
  exit 2
fi
if port_in_use; then
  echo "demo.sh: something listens on port $port already; choose another: --listen 127.0.0.1:5001" >&2
  exit 1
fi

# Builds and installs into the state folder as the main job does; the host
# is started inside the test network below.
prepare_main_job
tn_root=$root
tn_state=$state
tn_build=$build
tn_logs="$tn_state/logs"

# shellcheck source-path=SCRIPTDIR/../testnet disable=SC2154
source "$tn_root/testnet/testnet-host.sh"

# shellcheck disable=SC2317 # called by the trap
teardown() {
  trap - EXIT INT TERM HUP
  echo
  echo "demo: stopping the host and removing the test network"
  tn_down
}
trap teardown EXIT
trap 'exit 130' INT TERM HUP

name="zd$$"
echo "== test network $name"
tn_up "$name"
tn_start_dns
tn_have_probe || {
  echo "demo: $tn_build/bin/zark-probed is not built" >&2
  exit 1
}
tn_start_probe
tn_configure_probe
probe="zark-probed on $TN_WAN_OUTSIDE:$TN_PROBE_PORT (log: $tn_logs/probe.log)"
tn_start_host
tn_start_relay "$address" "$port"

cat <<EOF

The demo runs. Open

    http://$address:$port/

  account:   admin
  password:  $(cat "$password_file" 2>/dev/null || echo "see $tn_state/etc/zark")
  state:     $tn_state
  logs:      $tn_logs (syslog.log: the host's syslog lines)
  renewal:   the keeper in zark-webapid checks the router every ${ZARK_KEEPER_INTERVAL:-300} s
             and restores the mappings it lost (ZARK_KEEPER_INTERVAL)

  server     $(tn_server_ns): 192.168.77.2, zark-webapid on its 127.0.0.1:5000
  router     $name-r: miniupnpd, UPnP IGD $TN_ROOT_DESC and NAT-PMP
  outside    $(tn_outside_ns): $probe

To try it: Router, "Detect router", then "Use the detected router below"
(or choose "Generic / UPnP IGD" or "NAT-PMP" from the known routers) and
save; Rules, add rules and "Save and apply"; Test, "Start test". What the
router holds:

    ip netns exec $(tn_server_ns) upnpc -u $TN_ROOT_DESC -l

and from outside, a program listening on the server behind a rule from
router port 18080 to local port 8080:

    ip netns exec $(tn_server_ns) socat TCP-LISTEN:8080,fork SYSTEM:'echo hello' &
    ip netns exec $(tn_outside_ns) socat - TCP:1.2.3.1:18080

Ctrl-C stops it all.
EOF

# The host runs in its own process group; this shell waits for it and
# passes Ctrl-C and SIGTERM on through the traps (teardown).
while kill -0 "$tn_host_pid" 2>/dev/null; do
  wait "$tn_host_pid" || true
done
echo "demo: zark-webapid ended; see $tn_logs/syslog.log" >&2
exit 1
