# shellcheck shell=bash disable=SC2154
# (tn_root, tn_build, tn_state and tn_logs are set by the caller.)
#
# The host in the test network, for the demo (scripts/demo.sh) and the
# end-to-end browser test (tests/e2e/run-e2e.sh). Sourced, not run.
#
#   outside  1.2.3.2      zark-probed on port 7777 (when it is built)
#      |
#   router   1.2.3.1 / 192.168.77.1   miniupnpd (UPnP IGD + NAT-PMP), and
#                          dnsmasq as the network's name server, which
#                          knows one name: example.com, 1.2.3.2
#      |
#   server   192.168.77.2  zark-webapid on 127.0.0.1:5000, in a private
#                          mount namespace (packaging/sandbox.sh) whose
#                          /etc/resolv.conf names the router
#      |
#   the machine: 127.0.0.1:PORT relayed into the server's 127.0.0.1:5000 by
#   socat, one "ip netns exec" per connection
#
# The caller sets tn_root (the repository), tn_build, tn_state (a staged
# state folder, packaging/sandbox.sh stage) and tn_logs (a folder for the
# programs' output), calls tn_up NAME, then the starts it needs, and
# tn_down on every exit path (trap). Every wait is bounded.

readonly TN_WAN_OUTSIDE=1.2.3.2
readonly TN_PROBE_PORT=7777
readonly TN_HOST_PORT=5000
readonly TN_ROOT_DESC=http://192.168.77.1:5000/rootDesc.xml
readonly TN_LAN_ROUTER=192.168.77.1
# The name router detection looks up (the library's default
# dns_probe_name), and the address the network's name server gives it.
readonly TN_DNS_NAME=example.com

tn_name=""
tn_probe_pid=""
tn_dns_pid=""
tn_host_pid=""
tn_relay_pid=""

tn_log() { echo "testnet-host: $*" >&2; }

# Waits up to SECONDS for "ss -Hl<tn|un> sport = :PORT" in namespace NS to
# list a socket, while PID (if given) lives.
tn_wait_listening() {
  local ns=$1 kind=$2 port=$3 seconds=$4 pid=${5:-} i
  for ((i = 0; i < seconds * 20; i++)); do
    if [ -n "$(ip netns exec "$ns" ss "-Hl$kind" "sport = :$port" 2>/dev/null)" ]; then
      return 0
    fi
    if [ -n "$pid" ] && ! kill -0 "$pid" 2>/dev/null; then
      return 1
    fi
    sleep 0.05
  done
  return 1
}

# Ends a process started with setsid (so the leader of its own process
# group) and what it started: SIGTERM to the process alone (the host stops
# its own tasks), up to SECONDS for it to end, then SIGKILL to the group.
tn_stop_group() {
  local pid=$1 seconds=$2 i
  [ -n "$pid" ] || return 0
  kill -TERM "$pid" 2>/dev/null || true
  for ((i = 0; i < seconds * 20; i++)); do
    kill -0 "$pid" 2>/dev/null || break
    sleep 0.05
  done
  kill -KILL -- "-$pid" 2>/dev/null || true
  wait "$pid" 2>/dev/null || true
}

tn_up() {
  tn_name=$1
  bash "$tn_root/testnet/testnet.sh" up "$tn_name"
}

tn_server_ns() { echo "$tn_name-s"; }
tn_outside_ns() { echo "$tn_name-o"; }

# True when the probe service is built.
tn_have_probe() { [ -x "$tn_build/bin/zark-probed" ]; }

# Starts zark-probed on the outside host.
tn_start_probe() {
  mkdir -p "$tn_logs"
  setsid ip netns exec "$tn_name-o" "$tn_build/bin/zark-probed" \
    --listen "$TN_WAN_OUTSIDE:$TN_PROBE_PORT" >"$tn_logs/probe.log" 2>&1 &
  tn_probe_pid=$!
  if ! tn_wait_listening "$tn_name-o" tn "$TN_PROBE_PORT" 5 "$tn_probe_pid"; then
    tn_log "zark-probed did not start:"
    cat "$tn_logs/probe.log" >&2
    return 1
  fi
}

# Starts the network's name server on the router's LAN address, the way a
# home router serves its network, and makes it the server's name server.
tn_start_dns() {
  mkdir -p "$tn_logs"
  setsid ip netns exec "$tn_name-r" dnsmasq --keep-in-foreground \
    --conf-file=/dev/null --no-resolv --no-hosts --no-poll \
    --bind-interfaces --listen-address="$TN_LAN_ROUTER" --port=53 \
    --user=root --group=root --pid-file= --log-facility=- \
    --address="/$TN_DNS_NAME/$TN_WAN_OUTSIDE" >"$tn_logs/dns.log" 2>&1 &
  tn_dns_pid=$!
  if ! tn_wait_listening "$tn_name-r" un 53 5 "$tn_dns_pid"; then
    tn_log "dnsmasq did not start:"
    cat "$tn_logs/dns.log" >&2
    return 1
  fi
  # packaging/sandbox.sh puts it in place of /etc/resolv.conf.
  echo "nameserver $TN_LAN_ROUTER" >"$tn_state/resolv.conf"
}

# Sets KEY=VALUE in the library configuration of the state folder, keeping
# its other lines.
tn_set_portmap_conf() {
  local key=$1 value=$2
  local conf="$tn_state/etc/portforward/portmap.conf"
  mkdir -p "$(dirname "$conf")"
  touch "$conf"
  grep -v "^[[:space:]]*${key}[[:space:]]*=" "$conf" >"$conf.new" || true
  echo "$key=$value" >>"$conf.new"
  mv "$conf.new" "$conf"
}

# The outside host as the library's probe service and WAN check target.
tn_configure_probe() {
  tn_set_portmap_conf probe_service_address "$TN_WAN_OUTSIDE:$TN_PROBE_PORT"
  tn_set_portmap_conf wan_probe_hosts "$TN_WAN_OUTSIDE:$TN_PROBE_PORT"
}

# Starts the installed host of the state folder in the server namespace on
# its 127.0.0.1:5000, with a private mount namespace.
tn_start_host() {
  mkdir -p "$tn_logs"
  setsid ip netns exec "$tn_name-s" \
    bash "$tn_root/packaging/sandbox.sh" host "$tn_state" \
    --listen "127.0.0.1:$TN_HOST_PORT" >"$tn_logs/host.log" 2>&1 &
  tn_host_pid=$!
  if ! tn_wait_listening "$tn_name-s" tn "$TN_HOST_PORT" 15 "$tn_host_pid"; then
    tn_log "zark-webapid did not start (see $tn_logs/syslog.log):"
    cat "$tn_logs/host.log" >&2
    return 1
  fi
}

# Relays ADDRESS:PORT of the machine to the host in the server namespace.
tn_start_relay() {
  local address=$1 port=$2
  if [ -n "$(ss -Hltn "sport = :$port" 2>/dev/null)" ]; then
    tn_log "port $port of the machine is in use already"
    return 1
  fi
  setsid socat "TCP-LISTEN:$port,bind=$address,reuseaddr,fork" \
    "EXEC:ip netns exec $tn_name-s socat STDIO TCP\\:127.0.0.1\\:$TN_HOST_PORT" \
    >"$tn_logs/relay.log" 2>&1 &
  tn_relay_pid=$!
  local i
  for ((i = 0; i < 100; i++)); do
    [ -n "$(ss -Hltn "sport = :$port" 2>/dev/null)" ] && return 0
    kill -0 "$tn_relay_pid" 2>/dev/null || break
    sleep 0.05
  done
  tn_log "the relay did not start:"
  cat "$tn_logs/relay.log" >&2
  return 1
}

# The router's port mappings as upnpc lists them, asked from the server.
tn_router_mappings() {
  ip netns exec "$tn_name-s" timeout 20 upnpc -u "$TN_ROOT_DESC" -l
}

# Stops everything started above and removes the test network. Safe to call
# more than once and after a partial start.
tn_down() {
  tn_stop_group "$tn_relay_pid" 5
  tn_relay_pid=""
  # The host stops its background tasks and joins them before it exits.
  tn_stop_group "$tn_host_pid" 30
  tn_host_pid=""
  tn_stop_group "$tn_probe_pid" 5
  tn_probe_pid=""
  tn_stop_group "$tn_dns_pid" 5
  tn_dns_pid=""
tn_dns_pid=""
  if [ -n "$tn_name" ]; then
    bash "$tn_root/testnet/testnet.sh" down "$tn_name" || true
    tn_name=""
  fi
}
