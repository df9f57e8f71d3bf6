#!/usr/bin/env bash
# A router in a box for the integration tests: three network namespaces
# joined by veth pairs, and Debian's miniupnpd (UPnP IGD + NAT-PMP, NAT by
# nftables) on the router.
#
#   outside  (eth0 1.2.3.2/24)
#      |
#   router   (wan0 1.2.3.1/24, lan0 192.168.77.1/24; miniupnpd; nftables NAT)
#      |
#   server   (eth0 192.168.77.2/24, default route via 192.168.77.1)
#
# The outside link has an ordinary public-looking address (miniupnpd refuses
# every mapping behind a reserved one) that exists only in these namespaces;
# no namespace has a route anywhere else, and the router drops whatever is
# addressed outside the test network.
#
#   testnet.sh run PROGRAM [ARGS...]
#     brings a network up, runs PROGRAM in the server namespace with
#     ZARK_TESTNET_* describing the network, brings it down again (also when
#     PROGRAM fails or the script is interrupted) and exits with PROGRAM's
#     status. "PROGRAM --gtest_list_tests" runs without a network.
#     ZARK_TESTNET_UPNP_ALLOW, when set, is the router's only "allow"
#     permission rule (see start_router_daemon).
#   testnet.sh up NAME / testnet.sh down NAME
#     the two halves, for a person debugging (state in /run/zark-testnet).
#   testnet.sh router-stop NAME [--kill]
#     stops the router daemon of network NAME: SIGTERM (a daemon that shuts
#     down), or SIGKILL with --kill (a crash), and waits for it, at most
#     3 s. Its lease file is copied to the state folder first, as a router
#     keeps it on its own storage. The kernel keeps the forwarding rules the
#     daemon made (miniupnpd leaves them in place either way).
#   testnet.sh router-flush NAME
#     empties the nftables chains the daemon fills: the mappings a router
#     loses when it reboots.
#   testnet.sh router-start NAME [--keep-leases]
#     starts the router daemon again (after router-stop) and waits until it
#     listens; with --keep-leases it starts with the lease file router-stop
#     kept, otherwise with none.
#     The router-* commands are for tests that break the router on purpose
#     (tests/faults); ZARK_TESTNET_NAME, ZARK_TESTNET_STATE and
#     ZARK_TESTNET_SCRIPT tell a program started by "run" how to call them.
#
# Needs root. Bringing the network up takes about 0.2 s, down about 0.1 s.
set -euo pipefail

readonly WAN_ROUTER=1.2.3.1
readonly WAN_OUTSIDE=1.2.3.2
readonly WAN_NET=1.2.3.0/24
readonly LAN_ROUTER=192.168.77.1
readonly LAN_SERVER=192.168.77.2
readonly LAN_NET=192.168.77.0/24
readonly HTTP_PORT=5000
readonly MINIUPNPD=/usr/sbin/miniupnpd

log() { echo "testnet: $*" >&2; }

# Runs miniupnpd in the router namespace, in a mount namespace of its own:
# /dev/null over /dev/console (with no syslog daemon it writes every log
# line to the console and becomes 30 to 60 times slower) and a private tmpfs
# on /run/zark-router for its configuration, lease and pid files, which so
# vanish with it.
start_router_daemon() {
  local name=$1
  # A lease file to start with (router-start --keep-leases), or none.
  local leases=${2:-}
  # ZARK_TESTNET_UPNP_ALLOW replaces the router's permission rule (external
  # ports, internal network, internal ports), to give it a table of a known
  # size: "30500-30523 192.168.77.0/24 1-65535" lets it map 24 ports.
  local allow=${ZARK_TESTNET_UPNP_ALLOW:-"1-65535 $LAN_NET 1-65535"}
  ip netns exec "$name-r" unshare --mount --propagation private \
    bash -c '
      set -e
      mount --bind /dev/null /dev/console
      mkdir -p /run/zark-router
      mount -t tmpfs -o mode=0700 zark-router /run/zark-router
      if [ -n "'"$leases"'" ]; then
        cp "'"$leases"'" /run/zark-router/leases
      fi
      cat > /run/zark-router/miniupnpd.conf <<CONF
ext_ifname=wan0
listening_ip=lan0
http_port='"$HTTP_PORT"'
enable_upnp=yes
enable_natpmp=yes
secure_mode=yes
system_uptime=yes
notify_interval=600
clean_ruleset_interval=0
uuid=3d7a7c6e-0f00-4a5e-9b1e-000000000001
friendly_name=Zark test router
manufacturer_name=ZarkTest
manufacturer_url=http://192.168.77.1/
model_name=TestIGD
model_description=miniupnpd in a test network
model_number=1
serial=00000001
upnp_table_name=filter
upnp_nat_table_name=filter
lease_file=/run/zark-router/leases
allow '"$allow"'
deny 0-65535 0.0.0.0/0 0-65535
CONF
      exec '"$MINIUPNPD"' -d -f /run/zark-router/miniupnpd.conf \
        -P /run/zark-router/miniupnpd.pid
    ' >>"$state/router.log" 2>&1 &
  echo $! >"$state/router.pid"
}

# nftables on the router: the table and chains miniupnpd fills (its
# defaults: table "filter", chains "miniupnpd", "prerouting_miniupnpd",
# "postrouting_miniupnpd"), jumped to from the forward and NAT hooks, and
# masquerading on the outside link.
router_ruleset() {
  cat <<NFT
table inet filter {
  chain forward {
    type filter hook forward priority 0; policy drop;
    ct state established,related accept
    iifname "lan0" oifname "wan0" ip saddr $LAN_NET ip daddr $WAN_NET accept
    jump miniupnpd
  }
  chain miniupnpd {
  }
  chain output {
    type filter hook output priority 0; policy drop;
    oifname "lo" accept
    ip daddr { $WAN_NET, $LAN_NET, 239.255.255.250 } accept
    ip6 daddr ff00::/8 accept
  }
  chain prerouting {
    type nat hook prerouting priority -100; policy accept;
    jump prerouting_miniupnpd
  }
  chain prerouting_miniupnpd {
  }
  chain postrouting {
    type nat hook postrouting priority 100; policy accept;
    jump postrouting_miniupnpd
    oifname "wan0" masquerade
  }
  chain postrouting_miniupnpd {
  }
}
NFT
}

wait_for_router() {
  local name=$1 i
  # At most 5 s: the daemon listens within a few milliseconds.
  for ((i = 0; i < 500; i++)); do
    if [ -n "$(ip netns exec "$name-r" ss -Hltn "sport = :$HTTP_PORT")" ] &&
      [ -n "$(ip netns exec "$name-r" ss -Hlun "sport = :5351")" ]; then
      return 0
    fi
    if ! kill -0 "$(cat "$state/router.pid")" 2>/dev/null; then
      log "miniupnpd ended early:"
      cat "$state/router.log" >&2
      return 1
    fi
    sleep 0.01
  done
  log "miniupnpd did not listen within 5 s:"
  cat "$state/router.log" >&2
  return 1
}

up() {
  local name=$1
  mkdir -p "$state"
  ip netns add "$name-o"
  ip netns add "$name-r"
  ip netns add "$name-s"
  for ns in o r s; do
    ip -n "$name-$ns" link set lo up
  done
  ip -n "$name-r" link add wan0 type veth peer name eth0 netns "$name-o"
  ip -n "$name-r" link add lan0 type veth peer name eth0 netns "$name-s"
  ip -n "$name-o" addr add "$WAN_OUTSIDE/24" dev eth0
  ip -n "$name-r" addr add "$WAN_ROUTER/24" dev wan0
  ip -n "$name-r" addr add "$LAN_ROUTER/24" dev lan0
  ip -n "$name-s" addr add "$LAN_SERVER/24" dev eth0
  ip -n "$name-o" link set eth0 up
  ip -n "$name-r" link set wan0 up
  ip -n "$name-r" link set lan0 up
  ip -n "$name-s" link set eth0 up
  ip -n "$name-s" route add default via "$LAN_ROUTER"
  # SSDP answers go to multicast on the LAN.
  ip -n "$name-r" route add 239.0.0.0/8 dev lan0
  ip netns exec "$name-r" sysctl -qw net.ipv4.ip_forward=1
  router_ruleset | ip netns exec "$name-r" nft -f -
  start_router_daemon "$name"
  wait_for_router "$name"
}

down() {
  local name=$1
  if [ -f "$state/router.pid" ]; then
    local pid
    pid=$(cat "$state/router.pid")
    # SIGTERM ends miniupnpd (this version leaves its nftables rules
    # behind; they go with the namespace); bounded wait, then SIGKILL.
    if kill "$pid" 2>/dev/null; then
      for ((i = 0; i < 300; i++)); do
        kill -0 "$pid" 2>/dev/null || break
        sleep 0.01
      done
      kill -KILL "$pid" 2>/dev/null || true
    fi
    wait "$pid" 2>/dev/null || true
  fi
  for ns in s r o; do
    ip netns del "$name-$ns" 2>/dev/null || true
  done
  rm -rf "$state"
  rmdir /run/zark-testnet 2>/dev/null || true
}

# True when process PID has ended (gone, or a zombie nobody reaped yet).
process_ended() {
  local pid=$1 stat
  stat=$(cat "/proc/$pid/stat" 2>/dev/null) || return 0
  # "pid (comm) state ...": the state follows the last ")".
  stat=${stat##*) }
  [ "${stat%% *}" = Z ]
}

router_stop() {
  local name=$1 signal=$2 pid i
  if [ ! -f "$state/router.pid" ]; then
    log "router-stop $name: no router daemon runs"
    return 1
  fi
  pid=$(cat "$state/router.pid")
  if process_ended "$pid"; then
    log "router-stop $name: the router daemon ($pid) has ended already"
    rm -f "$state/router.pid"
    return 1
  fi
  # The lease file lives in the daemon's own mount namespace.
  if ! cp "/proc/$pid/root/run/zark-router/leases" "$state/leases.saved" \
    2>/dev/null; then
    : >"$state/leases.saved"
  fi
  kill "-$signal" "$pid"
  for ((i = 0; i < 300; i++)); do
    if process_ended "$pid"; then
      rm -f "$state/router.pid"
      return 0
    fi
    sleep 0.01
  done
  log "router-stop $name: the router daemon ($pid) did not end within 3 s"
  return 1
}

router_flush() {
  local name=$1 chain
  for chain in miniupnpd prerouting_miniupnpd postrouting_miniupnpd; do
    ip netns exec "$name-r" nft flush chain inet filter "$chain"
  done
}

router_start() {
  local name=$1 keep=$2 leases=""
  if [ -f "$state/router.pid" ] && ! process_ended "$(cat "$state/router.pid")"; then
    log "router-start $name: the router daemon runs already"
    return 1
  fi
  if [ "$keep" = 1 ] && [ -s "$state/leases.saved" ]; then
    leases="$state/leases.saved"
  fi
  start_router_daemon "$name" "$leases"
  wait_for_router "$name"
}

export_network() {
  local name=$1
  export ZARK_TESTNET_SERVER_NS="$name-s"
  export ZARK_TESTNET_ROUTER_NS="$name-r"
  export ZARK_TESTNET_OUTSIDE_NS="$name-o"
  export ZARK_TESTNET_WAN_ROUTER="$WAN_ROUTER"
  export ZARK_TESTNET_WAN_OUTSIDE="$WAN_OUTSIDE"
  export ZARK_TESTNET_LAN_ROUTER="$LAN_ROUTER"
  export ZARK_TESTNET_LAN_SERVER="$LAN_SERVER"
  export ZARK_TESTNET_ROOT_DESC="http://$LAN_ROUTER:$HTTP_PORT/rootDesc.xml"
  export ZARK_TESTNET_NAME="$name"
  export ZARK_TESTNET_STATE="$state"
  ZARK_TESTNET_SCRIPT="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)/$(basename "${BASH_SOURCE[0]}")"
  export ZARK_TESTNET_SCRIPT
}

command=${1:-}
shift || true
case "$command" in
run)
  for arg in "$@"; do
    if [ "$arg" = "--gtest_list_tests" ]; then
      exec "$@"
    fi
  done
  name="zt$$"
  state="/run/zark-testnet/$name"
  trap 'down "$name"' EXIT
  trap 'exit 130' INT TERM
  up "$name"
  export_network "$name"
  # Not exec: the trap must run after the program.
  set +e
  ip netns exec "$name-s" "$@"
  status=$?
  set -e
  exit "$status"
  ;;
up)
  name=$1
  state="/run/zark-testnet/$name"
  up "$name"
  ;;
down)
  name=$1
  state="/run/zark-testnet/$name"
  down "$name"
  ;;
router-stop)
  name=$1
  state="/run/zark-testnet/$name"
  signal=TERM
  if [ "${2:-}" = --kill ]; then
    signal=KILL
  fi
  router_stop "$name" "$signal"
  ;;
router-flush)
  name=$1
  state="/run/zark-testnet/$name"
  router_flush "$name"
  ;;
router-start)
  name=$1
  state="/run/zark-testnet/$name"
  keep=0
  if [ "${2:-}" = --keep-leases ]; then
    keep=1
  fi
  router_start "$name" "$keep"
  ;;
*)
  echo "usage: $0 run PROGRAM [ARGS...] | up NAME | down NAME" >&2
  echo "       $0 router-stop NAME [--kill] | router-flush NAME" >&2
  echo "       $0 router-start NAME [--keep-leases]" >&2
  exit 2
  ;;
esac
